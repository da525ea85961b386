#include "devicetree/devicetree.h"

#include "memory/tracking.h"
#include "support/strings.h"

namespace nimb {

DeviceTreeNode *gDeviceTreeRoot;
UINT32 gDeviceTreeNodeCount;
UINT32 gDeviceTreePropertyCount;
UINT32 gDeviceTreeValueBytes;

DeviceTreeNode *gFreeNodes;
DeviceTreeNode *gNodeBlocks;
DeviceTreeProperty *gFreeProperties;
DeviceTreeProperty *gPropertyBlocks;

// Size of a property image without its value.
constexpr UINT32 kPropertyHeaderSize = kDeviceTreeNameField + 4;

static UINT32 RoundUp4(UINT32 length) {
  return (length + 3) & ~static_cast<UINT32>(3);
}

// Makes a block of records, zero-filled once here and never again. Its first
// record is the chain head: it links to the block made before and keeps the
// block's address in `selfField`, where DeviceTreeFree finds it. The other
// records go on the free list in ascending order, so the highest is handed
// out first.
template <typename Record, typename Field>
static bool MakeBlock(Record *&freeList, Record *&chain, Field Record::*selfField) {
  Record *block = static_cast<Record *>(TrackedAllocatePool(kDeviceTreeBlockSize));
  if (block == nullptr) {
    return false;
  }
  bzero(block, kDeviceTreeBlockSize);
  block[0].*selfField = block;
  block[0].next = chain;
  chain = &block[0];
  constexpr UINTN records = kDeviceTreeBlockSize / sizeof(Record);
  for (UINTN i = 1; i < records; i++) {
    block[i].next = freeList;
    freeList = &block[i];
  }
  return true;
}

// Takes the head of a free list, making a block first when it is empty.
template <typename Record, typename Field>
static Record *TakeRecord(Record *&freeList, Record *&chain, Field Record::*selfField) {
  if (freeList == nullptr && !MakeBlock(freeList, chain, selfField)) {
    return nullptr;
  }
  Record *record = freeList;
  freeList = record->next;
  return record;
}

// A chain head lies inside the block it stands for: read its link first.
template <typename Record, typename Field>
static void ReleaseBlocks(Record *&chain, Field Record::*selfField) {
  Record *head = chain;
  while (head != nullptr) {
    Record *next = head->next;
    TrackedFree(const_cast<void *>(static_cast<const void *>(head->*selfField)));
    head = next;
  }
  chain = nullptr;
}

DeviceTreeNode *DeviceTreeInit() {
  gFreeNodes = nullptr;
  gNodeBlocks = nullptr;
  gFreeProperties = nullptr;
  gPropertyBlocks = nullptr;
  gDeviceTreeNodeCount = 0;
  gDeviceTreePropertyCount = 0;
  gDeviceTreeValueBytes = 0;
  gDeviceTreeRoot = nullptr;
  gDeviceTreeRoot = DeviceTreeAddChild(nullptr, "/");
  return gDeviceTreeRoot;
}

DeviceTreeNode *DeviceTreeAddChild(DeviceTreeNode *parent, const char *name) {
  DeviceTreeNode *node = TakeRecord(gFreeNodes, gNodeBlocks, &DeviceTreeNode::children);
  if (node == nullptr) {
    return nullptr;
  }
  if (parent != nullptr) {
    node->next = parent->children;
    parent->children = node;
  } else {
    node->next = nullptr;
    gDeviceTreeRoot = node;
  }
  gDeviceTreeNodeCount++;
  // A node whose name cannot be stored is kept all the same; it then
  // compares as "(null)".
  DeviceTreeAddProperty(node, "name", static_cast<UINT64>(strlen(name)) + 1, name, 1);
  return node;
}

DeviceTreeProperty *DeviceTreeAddProperty(DeviceTreeNode *node, const char *name, UINT64 length,
                                          const void *value, UINT8 copy) {
  if (node == nullptr) {
    return nullptr;
  }
  DeviceTreeProperty *property = TakeRecord(gFreeProperties, gPropertyBlocks, &DeviceTreeProperty::value);
  if (property == nullptr) {
    return nullptr;
  }
  property->name = name;
  property->length = static_cast<UINT32>(length);
  if (copy != 0 && value != nullptr) {
    void *duplicate = TrackedAllocatePool(property->length);
    if (duplicate == nullptr) {
      // The record is lost to the pool until the whole tree goes.
      return nullptr;
    }
    memcpy(duplicate, value, property->length);
    property->value = duplicate;
    property->valueCopied = 1;
  } else {
    // A null value has nothing to copy and flattens to zeros either way.
    property->value = value;
    property->valueCopied = 0;
  }
  property->next = nullptr;
  if (node->lastProperty != nullptr) {
    node->lastProperty->next = property;
  } else {
    node->properties = property;
  }
  node->lastProperty = property;
  gDeviceTreePropertyCount++;
  gDeviceTreeValueBytes += RoundUp4(property->length);
  return property;
}

DeviceTreeProperty *DeviceTreeFindProperty(DeviceTreeNode *node, const char *name) {
  if (node == nullptr) {
    return nullptr;
  }
  for (DeviceTreeProperty *property = node->properties; property != nullptr; property = property->next) {
    if (strcmp(property->name, name) == 0) {
      return property;
    }
  }
  return nullptr;
}

static const char *NodeName(DeviceTreeNode *node) {
  DeviceTreeProperty *name = DeviceTreeFindProperty(node, "name");
  if (name == nullptr || name->value == nullptr) {
    return "(null)";
  }
  return static_cast<const char *>(name->value);
}

DeviceTreeNode *DeviceTreeFindNode(const char *path, UINT8 create) {
  if (path == nullptr) {
    path = "";
  }
  char component[kDeviceTreeMaxComponent + 1];
  DeviceTreeNode *current = gDeviceTreeRoot;
  for (;;) {
    if (current == nullptr) {
      return nullptr;
    }
    while (*path == '/') {
      path++;
    }
    // At most kDeviceTreeMaxComponent characters: what is left of a longer
    // component starts the next one, one level deeper.
    UINTN length = 0;
    while (*path != '\0' && *path != '/' && length < kDeviceTreeMaxComponent) {
      component[length++] = *path++;
    }
    component[length] = '\0';
    if (length == 0) {
      return current;
    }
    DeviceTreeNode *child = current->children;
    while (child != nullptr && strcmp(NodeName(child), component) != 0) {
      child = child->next;
    }
    if (child == nullptr) {
      if (create == 0) {
        return nullptr;
      }
      child = DeviceTreeAddChild(current, component);
    }
    current = child;
  }
}

static void PutUint32(UINT8 *at, UINT32 value) {
  at[0] = static_cast<UINT8>(value);
  at[1] = static_cast<UINT8>(value >> 8);
  at[2] = static_cast<UINT8>(value >> 16);
  at[3] = static_cast<UINT8>(value >> 24);
}

// Writes a node's image at `at` into the zeroed area and returns the position
// behind it. The counts are those of the walk. Recursion stops at
// kDeviceTreeMaxDepth: a node there is written with a child count of 0, which
// keeps the image inside the size computed from the counters.
static UINT8 *WriteNode(const DeviceTreeNode *node, UINT8 *at, UINTN depth) {
  UINT8 *position = at + 8;
  UINT32 properties = 0;
  for (const DeviceTreeProperty *property = node->properties; property != nullptr;
       property = property->next) {
    // The field holds 31 characters and a NUL: a longer name is cut to its
    // first 31 characters, so that the image keeps the size that the
    // counters give.
    strncpy(reinterpret_cast<char *>(position), property->name, kDeviceTreeNameField - 1);
    PutUint32(position + kDeviceTreeNameField, property->length);
    if (property->value != nullptr && property->length != 0) {
      memcpy(position + kPropertyHeaderSize, property->value, property->length);
    }
    position += kPropertyHeaderSize + RoundUp4(property->length);
    properties++;
  }
  PutUint32(at, properties);
  UINT32 children = 0;
  if (depth < kDeviceTreeMaxDepth) {
    for (const DeviceTreeNode *child = node->children; child != nullptr; child = child->next) {
      position = WriteNode(child, position, depth + 1);
      children++;
    }
  }
  PutUint32(at + 4, children);
  return position;
}

void DeviceTreeFlatten(UINT64 *buffer, UINT64 *size) {
  UINT64 total = 8 * static_cast<UINT64>(gDeviceTreeNodeCount) +
                 static_cast<UINT64>(kPropertyHeaderSize) * gDeviceTreePropertyCount + gDeviceTreeValueBytes;
  if (buffer != nullptr) {
    if (total == 0) {
      *buffer = 0;
    } else {
      UINT8 *area = reinterpret_cast<UINT8 *>(static_cast<UINTN>(*buffer));
      if (area == nullptr) {
        area = static_cast<UINT8 *>(TrackedAllocatePool(static_cast<UINTN>(total)));
      }
      // A refused allocation leaves *buffer null.
      if (area != nullptr) {
        bzero(area, static_cast<UINTN>(total));
        if (gDeviceTreeRoot != nullptr) {
          WriteNode(gDeviceTreeRoot, area, 0);
        }
        *buffer = reinterpret_cast<UINTN>(area);
      }
    }
  }
  if (size != nullptr) {
    *size = total;
  }
}

void DeviceTreeFree() {
  ReleaseBlocks(gNodeBlocks, &DeviceTreeNode::children);
  ReleaseBlocks(gPropertyBlocks, &DeviceTreeProperty::value);
  gFreeNodes = nullptr;
  gFreeProperties = nullptr;
  gDeviceTreeRoot = nullptr;
  gDeviceTreeNodeCount = 0;
  gDeviceTreePropertyCount = 0;
  gDeviceTreeValueBytes = 0;
}

}  // namespace nimb
