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
  for (UINTN offset = 0; descriptorSize != 0 && offset + descriptorSize <= mapSize; offset += descriptorSize) {
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
void MemoryStockPool();
EFI_STATUS MemoryMeterFreePages(MemoryMeter *meter, UINT64 *pages);

}  // namespace nimb::platform
