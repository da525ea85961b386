#include "devicetree.h"

#include "memory.h"
#include "report.h"
#include "text.h"

namespace nimb::guest {

namespace {

constexpr char kNullName[] = "(null)";
constexpr uint32_t kValueBytesShown = 64;

// Reads the property image at `offset`; the status says why it can't.
TreeStatus ReadProperty(const uint8_t *tree, uint32_t length, uint32_t offset, TreeProperty *property,
                        uint32_t *end) {
  if (length - offset < kTreePropertyHeaderSize) {
    return kTreeTruncated;
  }
  const uint8_t *image = tree + offset;
  bool terminated = false;
  for (uint32_t i = 0; i < kTreeNameSize && !terminated; i++) {
    terminated = image[i] == 0;
  }
  if (!terminated) {
    return kTreeUnterminated;
  }
  uint32_t valueLength = Le32(image + kTreeNameSize);
  uint64_t padded = (static_cast<uint64_t>(valueLength) + 3) & ~3ull;
  if (padded > length - offset - kTreePropertyHeaderSize) {
    return kTreeTruncated;
  }
  property->name = reinterpret_cast<const char *>(image);
  property->value = image + kTreePropertyHeaderSize;
  property->length = valueLength;
  property->offset = offset;
  *end = offset + kTreePropertyHeaderSize + static_cast<uint32_t>(padded);
  return kTreeOk;
}

// The node's name: its first property, when that is "name" with a value
// that ends in a NUL.
const char *NodeName(const uint8_t *tree, uint32_t length, uint32_t offset, uint32_t propertyCount) {
  TreeProperty first;
  uint32_t end;
  if (propertyCount == 0 || ReadProperty(tree, length, offset, &first, &end) != kTreeOk) {
    return nullptr;
  }
  if (!TextEqual(first.name, "name") || first.length == 0 || first.value[first.length - 1] != 0) {
    return nullptr;
  }
  return reinterpret_cast<const char *>(first.value);
}

// Appends "/name" to the path; a path that would not fit ends in "...".
uint32_t AppendPath(char *path, uint32_t used, const char *name) {
  const char *parts[2] = {"/", name};
  for (const char *part : parts) {
    for (; *part != '\0'; part++) {
      if (used + 1 >= kTreePathSize) {
        path[kTreePathSize - 4] = path[kTreePathSize - 3] = path[kTreePathSize - 2] = '.';
        path[kTreePathSize - 1] = '\0';
        return kTreePathSize - 1;
      }
      path[used++] = *part;
    }
  }
  path[used] = '\0';
  return used;
}

}  // namespace

const char *TreeStatusText(TreeStatus status) {
  switch (status) {
    case kTreeOk:
      return "ok";
    case kTreeTruncated:
      return "runs past its length";
    case kTreeUnterminated:
      return "property name without NUL";
    case kTreeTooDeep:
      return "nested too deep";
    case kTreeTrailing:
      return "bytes left behind the root";
  }
  return "unknown";
}

TreeWalkResult TreeWalk(const uint8_t *tree, uint32_t length, const TreeVisitor &visitor, void *context) {
  TreeWalkResult result = {kTreeOk, 0, 0, 0};
  // Per level: the nodes still to read there, and the length of the parent's
  // path, which the nodes of that level extend.
  uint32_t remaining[kTreeMaxDepth];
  uint32_t parentPath[kTreeMaxDepth];
  char path[kTreePathSize];
  uint32_t depth = 0;
  remaining[0] = 1;
  parentPath[0] = 0;
  uint32_t offset = 0;
  for (;;) {
    result.offset = offset;
    if (tree == nullptr || length - offset < kTreeNodeHeaderSize) {
      result.status = kTreeTruncated;
      return result;
    }
    TreeNode node;
    node.propertyCount = Le32(tree + offset);
    node.childCount = Le32(tree + offset + 4);
    node.offset = offset;
    node.depth = depth;
    node.name = NodeName(tree, length, offset + kTreeNodeHeaderSize, node.propertyCount);
    uint32_t pathLength;
    if (depth == 0) {
      path[0] = '/';
      path[1] = '\0';
      pathLength = 0;  // the root adds nothing to its children's paths
    } else {
      pathLength = AppendPath(path, parentPath[depth], node.name != nullptr ? node.name : kNullName);
    }
    node.path = path;
    result.nodes++;
    remaining[depth]--;
    if (visitor.node != nullptr) {
      visitor.node(context, node);
    }

    offset += kTreeNodeHeaderSize;
    for (uint32_t i = 0; i < node.propertyCount; i++) {
      result.offset = offset;
      TreeProperty property;
      uint32_t end;
      TreeStatus status = ReadProperty(tree, length, offset, &property, &end);
      if (status != kTreeOk) {
        result.status = status;
        return result;
      }
      result.properties++;
      if (visitor.property != nullptr) {
        visitor.property(context, node, property);
      }
      offset = end;
    }

    if (node.childCount != 0) {
      if (depth + 1 >= kTreeMaxDepth) {
        result.offset = node.offset;
        result.status = kTreeTooDeep;
        return result;
      }
      depth++;
      remaining[depth] = node.childCount;
      parentPath[depth] = pathLength;
      continue;
    }
    while (remaining[depth] == 0) {
      if (depth == 0) {
        result.offset = offset;
        result.status = offset == length ? kTreeOk : kTreeTrailing;
        return result;
      }
      depth--;
    }
    // The next sibling replaces this node's part of the path.
    path[parentPath[depth]] = '\0';
  }
}

namespace {

struct FindContext {
  const char *path;
  const char *name;
  TreeProperty *found;
  bool matched;
};

void FindVisitProperty(void *context, const TreeNode &node, const TreeProperty &property) {
  FindContext *find = static_cast<FindContext *>(context);
  if (!find->matched && TextEqual(node.path, find->path) && TextEqual(property.name, find->name)) {
    *find->found = property;
    find->matched = true;
  }
}

}  // namespace

bool TreeFindProperty(const uint8_t *tree, uint32_t length, const char *path, const char *name,
                      TreeProperty *found) {
  FindContext find = {path, name, found, false};
  TreeWalk(tree, length, TreeVisitor{nullptr, FindVisitProperty}, &find);
  return find.matched;
}

namespace {

bool IsText(uint8_t byte) {
  return (byte >= 0x20 && byte <= 0x7E) || byte == '\t' || byte == '\n' || byte == '\r';
}

bool IsCString(const uint8_t *value, uint32_t length) {
  if (length == 0 || value[length - 1] != 0) {
    return false;
  }
  for (uint32_t i = 0; i + 1 < length; i++) {
    if (!IsText(value[i])) {
      return false;
    }
  }
  return true;
}

bool IsUcs2String(const uint8_t *value, uint32_t length) {
  // At least two characters, so that a small number is not taken for text.
  if (length < 6 || length % 2 != 0 || value[length - 1] != 0 || value[length - 2] != 0) {
    return false;
  }
  for (uint32_t i = 0; i + 2 < length; i += 2) {
    if (!IsText(value[i]) || value[i + 1] != 0) {
      return false;
    }
  }
  return true;
}

}  // namespace

bool PrintTreeValue(const uint8_t *value, uint32_t length) {
  if (IsCString(value, length)) {
    PrintQuoted(reinterpret_cast<const char *>(value), length);
    return false;
  }
  if (IsUcs2String(value, length)) {
    Print("u\"");
    for (uint32_t i = 0; i + 2 < length; i += 2) {
      PrintTextByte(value[i]);
    }
    Print("\"");
    return false;
  }
  Print("<");
  uint32_t shown = length < kValueBytesShown ? length : kValueBytesShown;
  for (uint32_t i = 0; i < shown; i++) {
    if (i != 0) {
      Print(" ");
    }
    Print("%02x", value[i]);
  }
  if (shown < length) {
    Print(" ...> (%u bytes)", length);
  } else {
    Print(">");
  }
  return true;
}

namespace {

void PrintIndent(uint32_t depth) {
  for (uint32_t i = 0; i < depth; i++) {
    Print("  ");
  }
}

void PrintVisitNode(void *, const TreeNode &node) {
  LineStart();
  Print("tree ");
  PrintIndent(node.depth);
  const char *name = node.name != nullptr ? node.name : kNullName;
  if (node.depth == 0 && TextEqual(name, "/")) {
    Print("/");
  } else {
    Print("%s/", name);
  }
  Print(" (%u %s, %u %s)", node.propertyCount, node.propertyCount == 1 ? "property" : "properties",
        node.childCount, node.childCount == 1 ? "child" : "children");
  LineEnd();
}

void PrintVisitProperty(void *, const TreeNode &node, const TreeProperty &property) {
  LineStart();
  Print("tree ");
  PrintIndent(node.depth + 1);
  Print("%s = ", property.name);
  bool bytes = PrintTreeValue(property.value, property.length);
  // Numbers as numbers too; a range as its address and length.
  if (bytes && property.length == 8 && TextEqual(node.path, kTreeMemoryMapPath)) {
    Print(" (address 0x%x, length 0x%x)", Le32(property.value), Le32(property.value + 4));
  } else if (bytes && property.length == 8) {
    Print(" (0x%llx)", static_cast<unsigned long long>(Le64(property.value)));
  } else if (bytes && property.length == 4) {
    Print(" (0x%x)", Le32(property.value));
  }
  LineEnd();
  // A value cut short above comes whole on a line of its own, so that it can
  // be compared byte for byte.
  if (bytes && property.length > kValueBytesShown) {
    LineStart();
    Print("value %s %s ", node.path, property.name);
    for (uint32_t i = 0; i < property.length; i++) {
      Print("%02x", property.value[i]);
    }
    LineEnd();
  }
}

}  // namespace

TreeWalkResult TreePrint(const uint8_t *tree, uint32_t length) {
  TreeWalkResult result = TreeWalk(tree, length, TreeVisitor{PrintVisitNode, PrintVisitProperty}, nullptr);
  if (result.status != kTreeOk) {
    Line("tree error %s at offset 0x%x", TreeStatusText(result.status), result.offset);
  }
  return result;
}

}  // namespace nimb::guest
