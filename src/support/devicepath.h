// Device paths: measuring, walking, finding nodes and copying.
//
// Every walk of a device path in the loader goes through the routines here,
// and every walk is bounded: it knows how many bytes the path may occupy and
// stops, rather than reading on or looping, at a node that doesn't fit. A
// path read from NVRAM is bounded by its variable's size; a path the firmware
// hands over has no stated size and is bounded by kMaxDevicePathSize.
//
// A node is well formed when its four head bytes lie within the bound and,
// unless it ends the path, its length is at least 4 and reaches no further
// than the bound. The length of the end node is never used: nothing follows
// it. A walk that meets a malformed node stops there, as it would at the end
// of the path, and the routines below report the path as malformed.
//
// The walk:
//
//   UINTN remaining = size;
//   const EFI_DEVICE_PATH_PROTOCOL *node = DevicePathFirstNode(path, &remaining);
//   for (; node != nullptr && !IsDevicePathEnd(node); node = DevicePathNextNode(node, &remaining)) {
//     ...
//   }
//   // node == nullptr: the path is malformed; otherwise node is its end.
#pragma once

#include "efi/efi.h"

namespace nimb {

// The bound of a path whose size nobody states (the firmware's own paths).
// Real paths are a few hundred bytes; the bound only keeps a walk over a
// damaged path from running through memory.
constexpr UINTN kMaxDevicePathSize = 0x10000;

// Size of a node's head: type, subtype and two bytes of length.
constexpr UINTN kDevicePathNodeHeadSize = 4;

// The node's length field, two bytes little-endian read one at a time (nodes
// are not aligned).
UINT16 DevicePathNodeLength(const EFI_DEVICE_PATH_PROTOCOL *node);
// The node's type with bit 7 cleared: only the low seven bits count.
UINT8 DevicePathNodeType(const EFI_DEVICE_PATH_PROTOCOL *node);
// True for the end of the whole path: type 0x7F in its low seven bits and
// subtype 0xFF. The end of one instance (subtype 0x01) is not an end.
BOOLEAN IsDevicePathEnd(const EFI_DEVICE_PATH_PROTOCOL *node);

// The first node of `path`, which may occupy `*remaining` bytes; null when
// `path` is null or the node is malformed.
const EFI_DEVICE_PATH_PROTOCOL *DevicePathFirstNode(const EFI_DEVICE_PATH_PROTOCOL *path, UINTN *remaining);
// The node behind `node` (a node that DevicePathFirstNode or
// DevicePathNextNode gave, with `*remaining` the bytes from it to the bound),
// with `*remaining` reduced by the step; null when `node` ends the path or
// the next node is malformed.
const EFI_DEVICE_PATH_PROTOCOL *DevicePathNextNode(const EFI_DEVICE_PATH_PROTOCOL *node, UINTN *remaining);

// The size of the whole path, its end node's 4 bytes included, when it ends
// within `bound` bytes; 0 for a null or malformed path, so that a caller
// treats such a path as absent.
UINTN DevicePathSizeWithin(const EFI_DEVICE_PATH_PROTOCOL *path, UINTN bound);
// DevicePathSizeWithin with the bound of the firmware's paths.
UINTN DevicePathSize(const EFI_DEVICE_PATH_PROTOCOL *path);
// The first node of `type` (low seven bits compared) and `subType` in front of
// the end of a path of at most `bound` bytes; null when the end, or a
// malformed node, comes first.
const EFI_DEVICE_PATH_PROTOCOL *DevicePathFindNode(const EFI_DEVICE_PATH_PROTOCOL *path, UINTN bound,
                                                   UINT8 type, UINT8 subType);

// The handle's device path protocol, or null when it has none.
EFI_DEVICE_PATH_PROTOCOL *DevicePathFromHandle(EFI_HANDLE handle);
// An untracked copy of a path from AllocateCopyPool; null for a null or
// malformed path or when memory runs out. A caller that keeps it gives it to
// TrackPool.
EFI_DEVICE_PATH_PROTOCOL *DuplicateDevicePath(const EFI_DEVICE_PATH_PROTOCOL *path);
// An untracked pool block of `size` bytes holding a copy of `source`, made
// with the firmware's CopyMem; null when memory runs out.
void *AllocateCopyPool(UINTN size, const void *source);

}  // namespace nimb
