#include "support/devicepath.h"

#include "boot/boot.h"
#include "memory/tracking.h"

namespace nimb {

UINT16 DevicePathNodeLength(const EFI_DEVICE_PATH_PROTOCOL *node) {
  return static_cast<UINT16>(node->Length[0] | (node->Length[1] << 8));
}

UINT8 DevicePathNodeType(const EFI_DEVICE_PATH_PROTOCOL *node) {
  return node->Type & 0x7F;
}

BOOLEAN IsDevicePathEnd(const EFI_DEVICE_PATH_PROTOCOL *node) {
  return DevicePathNodeType(node) == END_DEVICE_PATH_TYPE && node->SubType == END_ENTIRE_DEVICE_PATH_SUBTYPE;
}

// `node` if it is well formed with `remaining` bytes left from it, else null.
static const EFI_DEVICE_PATH_PROTOCOL *CheckNode(const EFI_DEVICE_PATH_PROTOCOL *node, UINTN remaining) {
  if (remaining < kDevicePathNodeHeadSize) {
    return nullptr;
  }
  if (IsDevicePathEnd(node)) {
    return node;
  }
  const UINTN length = DevicePathNodeLength(node);
  if (length < kDevicePathNodeHeadSize || length > remaining) {
    return nullptr;
  }
  return node;
}

const EFI_DEVICE_PATH_PROTOCOL *DevicePathFirstNode(const EFI_DEVICE_PATH_PROTOCOL *path, UINTN *remaining) {
  if (path == nullptr) {
    return nullptr;
  }
  return CheckNode(path, *remaining);
}

const EFI_DEVICE_PATH_PROTOCOL *DevicePathNextNode(const EFI_DEVICE_PATH_PROTOCOL *node, UINTN *remaining) {
  if (IsDevicePathEnd(node)) {
    return nullptr;
  }
  // The node was checked when the walk reached it: its length is at least 4
  // and no more than what remains.
  const UINTN length = DevicePathNodeLength(node);
  *remaining -= length;
  return CheckNode(
      reinterpret_cast<const EFI_DEVICE_PATH_PROTOCOL *>(reinterpret_cast<const UINT8 *>(node) + length),
      *remaining);
}

UINTN DevicePathSizeWithin(const EFI_DEVICE_PATH_PROTOCOL *path, UINTN bound) {
  UINTN remaining = bound;
  const EFI_DEVICE_PATH_PROTOCOL *node = DevicePathFirstNode(path, &remaining);
  while (node != nullptr && !IsDevicePathEnd(node)) {
    node = DevicePathNextNode(node, &remaining);
  }
  if (node == nullptr) {
    return 0;
  }
  return bound - remaining + kDevicePathNodeHeadSize;
}

UINTN DevicePathSize(const EFI_DEVICE_PATH_PROTOCOL *path) {
  return DevicePathSizeWithin(path, kMaxDevicePathSize);
}

const EFI_DEVICE_PATH_PROTOCOL *DevicePathFindNode(const EFI_DEVICE_PATH_PROTOCOL *path, UINTN bound,
                                                   UINT8 type, UINT8 subType) {
  UINTN remaining = bound;
  const EFI_DEVICE_PATH_PROTOCOL *node = DevicePathFirstNode(path, &remaining);
  for (; node != nullptr && !IsDevicePathEnd(node); node = DevicePathNextNode(node, &remaining)) {
    if (DevicePathNodeType(node) == type && node->SubType == subType) {
      return node;
    }
  }
  return nullptr;
}

EFI_DEVICE_PATH_PROTOCOL *DevicePathFromHandle(EFI_HANDLE handle) {
  void *interface = nullptr;
  if (EFI_ERROR(gBS->HandleProtocol(handle, &gEfiDevicePathProtocolGuid, &interface))) {
    return nullptr;
  }
  return static_cast<EFI_DEVICE_PATH_PROTOCOL *>(interface);
}

EFI_DEVICE_PATH_PROTOCOL *DuplicateDevicePath(const EFI_DEVICE_PATH_PROTOCOL *path) {
  const UINTN size = DevicePathSize(path);
  if (size == 0) {
    return nullptr;
  }
  return static_cast<EFI_DEVICE_PATH_PROTOCOL *>(AllocateCopyPool(size, path));
}

void *AllocateCopyPool(UINTN size, const void *source) {
  void *copy = AllocatePool(size);
  if (copy != nullptr) {
    gBS->CopyMem(copy, source, size);
  }
  return copy;
}

}  // namespace nimb
