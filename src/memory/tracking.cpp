#include "memory/tracking.h"

#include "boot/boot.h"
#include "screen/console.h"

namespace nimb {

MemoryTag *gMemoryTags;
MemoryTag *gFreeMemoryTags;
MemoryTag *gMemoryTagBlocks;

void *AllocatePool(UINTN size) {
  void *address = nullptr;
  if (EFI_ERROR(gBS->AllocatePool(EfiBootServicesData, size, &address))) {
    return nullptr;
  }
  return address;
}

// Tags come from blocks of 4096 bytes taken with the untracked AllocatePool,
// so that a block carries no tag of its own. The last record of a block
// stands for the block on gMemoryTagBlocks; the others go on the free list in
// ascending order, so that the highest is handed out first.
// The memory that is to be tagged goes back to the firmware before the Fatal
// that a missing block of tags calls for, as nothing would free it later.
static MemoryTag *TakeMemoryTag(void *pool, EFI_PHYSICAL_ADDRESS pages, UINTN pageCount) {
  if (gFreeMemoryTags == nullptr) {
    MemoryTag *block = static_cast<MemoryTag *>(AllocatePool(kMemoryTagBlockSize));
    if (block == nullptr) {
      if (pool != nullptr) {
        gBS->FreePool(pool);
      } else {
        gBS->FreePages(pages, pageCount);
      }
      Fatal("Can't allocate memory tag");
    }
    MemoryTag *blockRecord = &block[kMemoryTagsPerBlock - 1];
    blockRecord->poolAddress = block;
    blockRecord->pageCount = 0;
    blockRecord->pageAddress = 0;
    blockRecord->next = gMemoryTagBlocks;
    gMemoryTagBlocks = blockRecord;
    for (UINTN i = 0; i < kMemoryTagsPerBlock - 1; i++) {
      block[i].next = gFreeMemoryTags;
      gFreeMemoryTags = &block[i];
    }
  }
  MemoryTag *tag = gFreeMemoryTags;
  gFreeMemoryTags = tag->next;
  tag->next = nullptr;
  return tag;
}

MemoryTag *TrackPool(void *address) {
  MemoryTag *tag = TakeMemoryTag(address, 0, 0);
  tag->poolAddress = address;
  tag->pageCount = 0;
  tag->pageAddress = 0;
  tag->next = gMemoryTags;
  gMemoryTags = tag;
  return tag;
}

void *TrackedAllocatePool(UINTN size) {
  void *address = AllocatePool(size);
  if (address != nullptr) {
    TrackPool(address);
  }
  return address;
}

EFI_STATUS TrackedAllocatePages(EFI_ALLOCATE_TYPE type, EFI_MEMORY_TYPE memoryType, UINTN pages,
                                EFI_PHYSICAL_ADDRESS *address) {
  EFI_STATUS status = gBS->AllocatePages(type, memoryType, pages, address);
  if (EFI_ERROR(status)) {
    return status;
  }
  MemoryTag *tag = TakeMemoryTag(nullptr, *address, pages);
  tag->poolAddress = nullptr;
  tag->pageCount = pages;
  tag->pageAddress = *address;
  tag->next = gMemoryTags;
  gMemoryTags = tag;
  return status;
}

// The firmware is asked first: a pool block goes back whether or not a tag
// is found for it.
EFI_STATUS TrackedFree(void *address) {
  MemoryTag **link = &gMemoryTags;
  for (; *link != nullptr; link = &(*link)->next) {
    const MemoryTag *tag = *link;
    if (tag->poolAddress != nullptr ? tag->poolAddress == address
                                    : tag->pageAddress == reinterpret_cast<UINT64>(address)) {
      break;
    }
  }
  MemoryTag *tag = *link;
  EFI_STATUS status = tag != nullptr && tag->poolAddress == nullptr
                          ? gBS->FreePages(tag->pageAddress, tag->pageCount)
                          : gBS->FreePool(address);
  if (EFI_ERROR(status) || tag == nullptr) {
    return status;
  }
  *link = tag->next;
  tag->next = gFreeMemoryTags;
  gFreeMemoryTags = tag;
  return status;
}

void TrackedFreeAll() {
  for (MemoryTag *tag = gMemoryTags; tag != nullptr; tag = tag->next) {
    if (tag->poolAddress != nullptr) {
      gBS->FreePool(tag->poolAddress);
    } else {
      gBS->FreePages(tag->pageAddress, tag->pageCount);
    }
  }
  // A block's record lies inside the block it frees: read the link first.
  MemoryTag *record = gMemoryTagBlocks;
  while (record != nullptr) {
    MemoryTag *next = record->next;
    gBS->FreePool(record->poolAddress);
    record = next;
  }
  gMemoryTags = nullptr;
  gFreeMemoryTags = nullptr;
  gMemoryTagBlocks = nullptr;
}

}  // namespace nimb
