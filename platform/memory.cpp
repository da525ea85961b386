#include "memory.h"

#include "firmware.h"

namespace nimb::platform {

namespace {

// Room beyond the map's present size: every allocation between two
// measurements may split a region in two.
constexpr UINTN kSpareDescriptors = 256;

// The pool's stock: for each of these sizes, blocks of that size are taken
// until kStockPages pages that hold nothing else have been seen; then all are
// given back but the first block of each page.
constexpr UINTN kStockSizes[] = {24, 56, 120, 248, 504, 1016, 2000};
constexpr UINTN kStockPages = 4;
constexpr UINTN kStockBlocks = 512;

}  // namespace

void MemoryStockPool() {
  void *blocks[kStockBlocks];
  for (const UINTN size : kStockSizes) {
    UINTN count = 0;
    UINTN pages = 0;
    UINT64 lastPage = ~0ULL;
    while (count < kStockBlocks && pages <= kStockPages) {
      if (EFI_ERROR(gBS->AllocatePool(EfiBootServicesData, size, &blocks[count]))) {
        break;
      }
      const UINT64 page = reinterpret_cast<UINT64>(blocks[count]) >> EFI_PAGE_SHIFT;
      if (page != lastPage) {
        pages++;
        lastPage = page;
      }
      count++;
    }
    lastPage = ~0ULL;
    for (UINTN i = 0; i < count; i++) {
      const UINT64 page = reinterpret_cast<UINT64>(blocks[i]) >> EFI_PAGE_SHIFT;
      if (page == lastPage) {
        gBS->FreePool(blocks[i]);
      }
      lastPage = page;
    }
  }
}

EFI_STATUS MemoryMeterInit(MemoryMeter *meter) {
  UINTN size = 0;
  UINTN key = 0;
  UINTN descriptorSize = 0;
  UINT32 version = 0;
  EFI_STATUS status = gBS->GetMemoryMap(&size, nullptr, &key, &descriptorSize, &version);
  if (status != EFI_BUFFER_TOO_SMALL) {
    return EFI_ERROR(status) ? status : EFI_DEVICE_ERROR;
  }
  meter->capacity = size * 2 + kSpareDescriptors * descriptorSize;
  void *buffer = nullptr;
  status = gBS->AllocatePool(EfiLoaderData, meter->capacity, &buffer);
  meter->map = static_cast<EFI_MEMORY_DESCRIPTOR *>(buffer);
  return status;
}

EFI_STATUS MemoryMeterFreePages(MemoryMeter *meter, UINT64 *pages) {
  UINTN size = meter->capacity;
  UINTN key = 0;
  UINTN descriptorSize = 0;
  UINT32 version = 0;
  const EFI_STATUS status = gBS->GetMemoryMap(&size, meter->map, &key, &descriptorSize, &version);
  if (EFI_ERROR(status)) {
    return status;
  }
  *pages = CountConventionalPages(meter->map, size, descriptorSize);
  return EFI_SUCCESS;
}

}  // namespace nimb::platform
