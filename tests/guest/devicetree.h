// Reading the flattened device tree that the loader hands over: a node image
// (property count, child count, the properties, then the children, each a
// whole subtree), with property images of a 32-byte name field, a length and
// the value padded to 4 bytes. The walk never reads outside the `length`
// bytes it is given, whatever the counts and lengths inside them claim.
#pragma once

#include <stdint.h>

namespace nimb::guest {

constexpr uint32_t kTreeNodeHeaderSize = 8;
constexpr uint32_t kTreeNameSize = 32;
constexpr uint32_t kTreePropertyHeaderSize = 36;
constexpr uint32_t kTreeMaxDepth = 16;
constexpr uint32_t kTreePathSize = 256;

// The node whose properties name the ranges handed to the kernel: each an
// address and a length, 32 bits each.
constexpr char kTreeMemoryMapPath[] = "/chosen/memory-map";

enum TreeStatus : uint32_t {
  kTreeOk,
  kTreeTruncated,     // a header or value runs past the end
  kTreeUnterminated,  // a property's name field has no NUL
  kTreeTooDeep,       // nodes nest deeper than kTreeMaxDepth
  kTreeTrailing,      // the root's image ends before the length does
};

const char *TreeStatusText(TreeStatus status);

struct TreeNode {
  // "/" for the root, "/chosen/memory-map" below it. A node without a
  // terminated "name" as its first property stands as "(null)".
  const char *path;
  const char *name;  // the "name" property's text, or null
  uint32_t depth;    // 0 for the root
  uint32_t propertyCount;
  uint32_t childCount;
  uint32_t offset;  // of the node's image in the tree
};

struct TreeProperty {
  const char *name;  // terminated inside its field
  const uint8_t *value;
  uint32_t length;
  uint32_t offset;  // of the property's image in the tree
};

// Called for each node before its properties, and for each property.
struct TreeVisitor {
  void (*node)(void *context, const TreeNode &node);
  void (*property)(void *context, const TreeNode &node, const TreeProperty &property);
};

struct TreeWalkResult {
  TreeStatus status;
  uint32_t offset;  // where the walk stopped: the length when it is kTreeOk
  uint32_t nodes;
  uint32_t properties;
};

TreeWalkResult TreeWalk(const uint8_t *tree, uint32_t length, const TreeVisitor &visitor, void *context);

// The first property `name` of the node at `path`; false when there is none
// (or the tree breaks off before it).
bool TreeFindProperty(const uint8_t *tree, uint32_t length, const char *path, const char *name,
                      TreeProperty *found);

// A property value as the report shows it: "text" for a NUL-terminated
// printable string, u"text" for a UCS-2 one, <00 11 ...> for other bytes
// (the first 64, then "...", and the length), <> for an empty value. True
// when it printed bytes.
bool PrintTreeValue(const uint8_t *value, uint32_t length);

// The tree as "kernel: tree" lines, two spaces of indent for each level:
// a node as its name and "/" (the root as "/") with its counts, a property as
// "name = value". A value of 4 or 8 bytes is followed by its number, a range
// of /chosen/memory-map by its address and length. A walk that fails ends
// in a "kernel: tree error" line.
TreeWalkResult TreePrint(const uint8_t *tree, uint32_t length);

}  // namespace nimb::guest
