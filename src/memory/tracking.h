// Tracking of firmware allocations: every pool block and page range the
// loader takes carries a tag, so that a failed boot gives all of it back with
// TrackedFreeAll before it returns to the firmware.
#pragma once

#include "efi/efi.h"

namespace nimb {

struct MemoryTag {
  void *poolAddress;   // pool allocation; null for pages
  UINT64 pageCount;    // pages of a page allocation; 0 for pool
  UINT64 pageAddress;  // physical address of a page allocation; 0 for pool
  MemoryTag *next;
};
static_assert(sizeof(MemoryTag) == 32, "a tag block holds 128 tags of 32 bytes");

constexpr UINTN kMemoryTagBlockSize = 4096;
constexpr UINTN kMemoryTagsPerBlock = kMemoryTagBlockSize / sizeof(MemoryTag);

extern MemoryTag *gMemoryTags;
extern MemoryTag *gFreeMemoryTags;
extern MemoryTag *gMemoryTagBlocks;

// The firmware's pool, EfiBootServicesData, untracked; null when refused.
void *AllocatePool(UINTN size);
void *TrackedAllocatePool(UINTN size);
MemoryTag *TrackPool(void *address);
EFI_STATUS TrackedAllocatePages(EFI_ALLOCATE_TYPE type, EFI_MEMORY_TYPE memoryType, UINTN pages,
                                EFI_PHYSICAL_ADDRESS *address);
// Gives back the pool block at `address`, or the tracked pages that begin
// there.
EFI_STATUS TrackedFree(void *address);
void TrackedFreeAll();

}  // namespace nimb
