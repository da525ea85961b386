#include "memory/tracking.h"

#include "boot/boot.h"
#include "screen/console.h"
#include "support/strings.h"

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

// The index of the live pool tags, so that TrackedFree finds a tag (and the
// tag before it in gMemoryTags) without walking the list. It is made when a
// free had to walk far, and then kept in step: open addressing over a power
// of two of slots from the untracked pool, at most half of them used. The
// slot of a pool tag holds the tag behind it on gMemoryTags (null for the
// head), which is what unlinking needs. Without memory for it, the list is
// walked as before.
struct MemoryTagSlot {
  MemoryTag *tag;
  MemoryTag *previous;
};
struct MemoryTagIndex {
  MemoryTagSlot *slots;
  UINT64 mask;      // slot count - 1
  UINT64 count;     // pool tags held
  MemoryTag *list;  // gMemoryTags when the index was last kept in step
};
static MemoryTagIndex gMemoryTagIndex;

// A free that walks further than this makes the index.
constexpr UINT64 kMemoryTagWalkLimit = 1024;
constexpr UINT64 kMemoryTagFirstSlots = 256;

static UINT64 SlotOf(const void *address, UINT64 mask) {
  UINT64 hash = (reinterpret_cast<UINTN>(address) >> 3) * 0x9E3779B97F4A7C15ULL;
  return (hash ^ (hash >> 29)) & mask;
}

// The index, or null when there is none. An index whose list was set aside
// from outside (the lists emptied without TrackedFreeAll) went with it.
static MemoryTagIndex *TagIndex() {
  if (gMemoryTagIndex.slots != nullptr && gMemoryTagIndex.list != gMemoryTags) {
    gMemoryTagIndex = {};
  }
  return gMemoryTagIndex.slots != nullptr ? &gMemoryTagIndex : nullptr;
}

static void DropTagIndex() {
  if (TagIndex() != nullptr) {
    gBS->FreePool(gMemoryTagIndex.slots);
  }
  gMemoryTagIndex = {};
}

// The slot of a pool tag of `address`: of `tag` itself when it is given, else
// of the first found; an empty slot when there is none.
static MemoryTagSlot *FindSlot(const MemoryTagIndex *index, const void *address, const MemoryTag *tag) {
  for (UINT64 i = SlotOf(address, index->mask);; i = (i + 1) & index->mask) {
    MemoryTagSlot *slot = &index->slots[i];
    if (slot->tag == nullptr || slot->tag == tag || (tag == nullptr && slot->tag->poolAddress == address)) {
      return slot;
    }
  }
}

// Makes the index anew over every pool tag, with four slots for each;
// without memory for it there is none.
static void RebuildTagIndex() {
  UINT64 count = 0;
  for (const MemoryTag *tag = gMemoryTags; tag != nullptr; tag = tag->next) {
    count += tag->poolAddress != nullptr;
  }
  UINT64 slots = kMemoryTagFirstSlots;
  while (slots < 4 * count) {
    slots *= 2;
  }
  DropTagIndex();
  MemoryTagIndex index = {static_cast<MemoryTagSlot *>(AllocatePool(slots * sizeof(MemoryTagSlot))),
                          slots - 1, count, gMemoryTags};
  if (index.slots == nullptr) {
    return;
  }
  bzero(index.slots, slots * sizeof(MemoryTagSlot));
  MemoryTag *previous = nullptr;
  for (MemoryTag *tag = gMemoryTags; tag != nullptr; previous = tag, tag = tag->next) {
    if (tag->poolAddress != nullptr) {
      *FindSlot(&index, tag->poolAddress, tag) = {tag, previous};
    }
  }
  gMemoryTagIndex = index;
}

// Pushes a tag on gMemoryTags, and into the index when there is one.
static void PushMemoryTag(MemoryTag *tag) {
  MemoryTagIndex *index = TagIndex();
  MemoryTag *head = gMemoryTags;
  tag->next = head;
  gMemoryTags = tag;
  if (index == nullptr) {
    return;
  }
  index->list = tag;
  if (head != nullptr && head->poolAddress != nullptr) {
    FindSlot(index, head->poolAddress, head)->previous = tag;
  }
  if (tag->poolAddress != nullptr) {
    if (2 * (index->count + 1) > index->mask + 1) {
      RebuildTagIndex();
    } else {
      *FindSlot(index, tag->poolAddress, tag) = {tag, nullptr};
      index->count++;
    }
  }
}

MemoryTag *TrackPool(void *address) {
  MemoryTag *tag = TakeMemoryTag(address, 0, 0);
  tag->poolAddress = address;
  tag->pageCount = 0;
  tag->pageAddress = 0;
  PushMemoryTag(tag);
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
  PushMemoryTag(tag);
  return status;
}

// Takes the slot out of the index; the slots behind it that belong nearer
// their home move up, so that no search stops short.
static void RemoveSlot(MemoryTagIndex *index, MemoryTagSlot *slot) {
  UINT64 hole = static_cast<UINT64>(slot - index->slots);
  for (UINT64 i = (hole + 1) & index->mask; index->slots[i].tag != nullptr; i = (i + 1) & index->mask) {
    const UINT64 home = SlotOf(index->slots[i].tag->poolAddress, index->mask);
    // The entry may move when its home is not cyclically in (hole, i].
    if (((i - home) & index->mask) >= ((i - hole) & index->mask)) {
      index->slots[hole] = index->slots[i];
      hole = i;
    }
  }
  index->slots[hole].tag = nullptr;
  index->count--;
}

static bool TagHolds(const MemoryTag *tag, const void *address) {
  return tag->poolAddress != nullptr ? tag->poolAddress == address
                                     : tag->pageAddress == reinterpret_cast<UINT64>(address);
}

// Gives back a pool block or tracked pages by their address. A pool block
// goes back whether or not a tag is found for it; the tag goes only when the
// firmware took the memory back.
EFI_STATUS TrackedFree(void *address) {
  MemoryTagIndex *index = TagIndex();
  MemoryTagSlot *slot = index != nullptr ? FindSlot(index, address, nullptr) : nullptr;
  MemoryTag *previous = nullptr;
  MemoryTag *tag = nullptr;
  UINT64 steps = 0;
  if (slot != nullptr && slot->tag != nullptr) {
    tag = slot->tag;
    previous = slot->previous;
  } else {
    // Without the index, or for pages (which it does not hold): the walk.
    slot = nullptr;
    for (tag = gMemoryTags; tag != nullptr && !TagHolds(tag, address); previous = tag, tag = tag->next) {
      steps++;
    }
  }
  EFI_STATUS status = tag != nullptr && tag->poolAddress == nullptr
                          ? gBS->FreePages(tag->pageAddress, tag->pageCount)
                          : gBS->FreePool(address);
  if (EFI_ERROR(status) || tag == nullptr) {
    return status;
  }
  if (index != nullptr) {
    MemoryTag *next = tag->next;
    if (next != nullptr && next->poolAddress != nullptr) {
      FindSlot(index, next->poolAddress, next)->previous = previous;
    }
    if (slot != nullptr) {
      RemoveSlot(index, slot);
    }
  } else if (steps > kMemoryTagWalkLimit) {
    index = &gMemoryTagIndex;
  }
  (previous != nullptr ? previous->next : gMemoryTags) = tag->next;
  tag->next = gFreeMemoryTags;
  gFreeMemoryTags = tag;
  if (index != nullptr) {
    gMemoryTagIndex.list = gMemoryTags;
    if (gMemoryTags == nullptr) {
      DropTagIndex();
    } else if (gMemoryTagIndex.slots == nullptr) {
      RebuildTagIndex();
    }
  }
  return status;
}

void TrackedFreeAll() {
  DropTagIndex();
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
