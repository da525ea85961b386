// The kernel region: the kernel's segments and, stacked above them,
// everything handed to the kernel. It only grows upward.
#pragma once

#include "efi/efi.h"

namespace nimb {

struct DeviceTreeNode;

extern UINT64 gKernelRegionTop;   // first free address above the region; 0 at start
extern UINT64 gKernelRegionBase;  // lowest address in the region; 0xFFFFFFFF at start

// `/chosen/memory-map`, where each range handed to the kernel is announced.
extern DeviceTreeNode *gMemoryMapNode;

// Allocates whole pages at exactly *address for *size bytes; *size becomes
// the rounded size. Returns the address, or 0 (with a message).
UINT64 AllocateKernelPages(UINT64 *address, UINT64 *size);
// Allocates at the top of the region and raises the top. Returns the
// address, or 0.
UINT64 AllocateKernelRegion(UINT64 *size);
// Announces a range of the region to the kernel as a property of
// /chosen/memory-map.
EFI_STATUS AddMemoryRange(const char *name, UINT64 address, UINT64 length, UINT32 type);

}  // namespace nimb
