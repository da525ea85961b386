// The device tree handed to the kernel: pooled nodes with named byte-string
// properties while booting, written out once in the flattened form that the
// kernel reads.
#pragma once

#include "efi/efi.h"

namespace nimb {

struct DeviceTreeProperty;

struct DeviceTreeNode {
  DeviceTreeProperty *properties;    // head of the property list
  DeviceTreeProperty *lastProperty;  // its tail
  DeviceTreeNode *children;          // head of the child list
  DeviceTreeNode *next;              // next sibling; the free-list link
};

struct DeviceTreeProperty {
  const char *name;   // not copied: kept alive by the caller until flattening
  UINT32 length;      // value length in bytes, unpadded
  const void *value;  // null for a value that flattens to zeros
  UINT8 valueCopied;  // 1 for a private copy
  DeviceTreeProperty *next;
};

// Records per block of 4096 bytes; the first record of a block is its chain head.
constexpr UINTN kDeviceTreeBlockSize = 4096;
constexpr UINTN kDeviceTreeNodesPerBlock = kDeviceTreeBlockSize / sizeof(DeviceTreeNode);
constexpr UINTN kDeviceTreePropertiesPerBlock = kDeviceTreeBlockSize / sizeof(DeviceTreeProperty);
static_assert(kDeviceTreeNodesPerBlock == 128, "128 nodes to a block");
static_assert(kDeviceTreePropertiesPerBlock == 102, "102 properties to a block");

// The flattened form: a node image is two 32-bit counts (properties,
// children), the property images, then the child images; a property image
// is a 32-byte name field, a 32-bit length and the value padded to 4 bytes.
constexpr UINTN kDeviceTreeNameField = 32;

// The longest path component DeviceTreeFindNode compares. A longer one is
// cut there, and its remaining characters start the next, deeper component.
constexpr UINTN kDeviceTreeMaxComponent = 30;

// Nesting below the root that DeviceTreeFlatten writes out; the loader's own
// tree goes three levels deep. A node at this depth is written with its
// properties and no children.
constexpr UINTN kDeviceTreeMaxDepth = 64;

extern DeviceTreeNode *gDeviceTreeRoot;
extern UINT32 gDeviceTreeNodeCount;      // nodes created
extern UINT32 gDeviceTreePropertyCount;  // properties created
extern UINT32 gDeviceTreeValueBytes;     // sum of the value lengths, each rounded up to 4

// Free records, highest address of the newest block first; and the block
// chains, newest block first, linked through the chain heads.
extern DeviceTreeNode *gFreeNodes;
extern DeviceTreeNode *gNodeBlocks;
extern DeviceTreeProperty *gFreeProperties;
extern DeviceTreeProperty *gPropertyBlocks;

// Empties the pools and counters (without releasing anything) and makes the
// root "/". Returns the root, or null.
DeviceTreeNode *DeviceTreeInit();
// Makes a node at the head of `parent`'s children, or the new root when
// `parent` is null; `name` is copied into its first property, "name".
// Returns null when no block can be had.
DeviceTreeNode *DeviceTreeAddChild(DeviceTreeNode *parent, const char *name);
// Appends a property; the low 32 bits of `length` are kept, `name` is kept by
// pointer, and `value` is copied when `copy` is non-zero. Returns null on
// failure (and for a null node).
DeviceTreeProperty *DeviceTreeAddProperty(DeviceTreeNode *node, const char *name, UINT64 length,
                                          const void *value, UINT8 copy);
// The first property of that name, or null.
DeviceTreeProperty *DeviceTreeFindProperty(DeviceTreeNode *node, const char *name);
// The node at a path from the root, `/`-separated; with `create` set, the
// missing nodes are made on the way. Null when not found or not made.
DeviceTreeNode *DeviceTreeFindNode(const char *path, UINT8 create);
// Writes the flattened tree to *buffer (allocated when *buffer is 0) and its
// size to *size; either pointer may be null.
void DeviceTreeFlatten(UINT64 *buffer, UINT64 *size);
// Gives back every block of both pools and empties the tree; copied values
// stay with the memory tracking.
void DeviceTreeFree();

}  // namespace nimb
