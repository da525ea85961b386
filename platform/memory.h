// The firmware's free memory, measured before and after the loader runs to
// see whether a boot that gave up returned everything it took.
#pragma once

#include "efi/efi.h"

namespace nimb::platform {

// Sum of the pages of EfiConventionalMemory in a memory map of `mapSize`
// bytes whose descriptors lie `descriptorSize` bytes apart (the firmware's
// stride, which may be larger than the structure).
inline UINT64 CountConventionalPages(const void *map, UINTN mapSize, UINTN descriptorSize) {
  UINT64 pages = 0;
  const UINT8 *bytes = static_cast<const UINT8 *>(map);
  for (UINTN offset = 0; descriptorSize != 0 && offset + descriptorSize <= mapSize;
       offset += descriptorSize) {
    const EFI_MEMORY_DESCRIPTOR *descriptor = reinterpret_cast<const EFI_MEMORY_DESCRIPTOR *>(bytes + offset);
    if (descriptor->Type == EfiConventionalMemory) {
      pages += descriptor->NumberOfPages;
    }
  }
  return pages;
}

// Holds the map buffer, allocated once so that measuring does not itself
// change the map.
struct MemoryMeter {
  EFI_MEMORY_DESCRIPTOR *map;
  UINTN capacity;
};

EFI_STATUS MemoryMeterInit(MemoryMeter *meter);
// Pages of EfiConventionalMemory now.
EFI_STATUS MemoryMeterFreePages(MemoryMeter *meter, UINT64 *pages);

// Stocks the firmware's boot services pool with free blocks of every size
// class, in pages that stay in the pool. Small blocks that the firmware keeps
// on the loader's behalf after it has gone (the file handles that it leaves
// open, for one) then come out of this stock instead of a fresh page, so
// that they don't show as lost memory. The price: a pool block of under 2 KiB
// that the loader itself fails to give back goes unseen, too; anything that
// takes pages of its own is seen.
void MemoryStockPool();

// Opens every directory under `root`, reads it to its end and closes it
// again; returns the number of directories, `root` counted. The file system
// driver keeps what it has read of a closed directory in a cache that it
// never gives back; filled before the first measurement, the cache no longer
// grows when the loader opens directories. A volume of more directories than
// the cache holds can still show a change.
UINTN MemoryWarmDirectoryCache(EFI_FILE_PROTOCOL *root);

}  // namespace nimb::platform
