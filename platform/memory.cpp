#include "memory.h"

#include "firmware.h"

namespace nimb::platform {

namespace {

// Room beyond the map's present size: every allocation between two
// measurements may split a region in two.
constexpr UINTN kSpareDescriptors = 256;

// The pool's stock: blocks of each of these sizes (spread over the pool's
// size classes, up to the largest that the pool serves from its own pages)
// are taken until they have spread over more than kStockPages pages, then
// all are given back but the first block in each page, which keeps that page
// and the free rest of it in the pool.
constexpr UINTN kStockSizes[] = {24, 56, 120, 248, 504, 1016, 2000};
constexpr UINTN kStockPages = 4;
constexpr UINTN kStockBlocks = 512;

// How deep the directory walk goes.
constexpr UINT32 kWarmDepth = 8;

UINTN WarmDirectory(EFI_FILE_PROTOCOL *directory, UINT32 depth) {
  UINTN directories = 1;
  UINT64 infoBuffer[kFileInfoBufferSize / sizeof(UINT64)];
  EFI_FILE_INFO *info = reinterpret_cast<EFI_FILE_INFO *>(infoBuffer);
  for (;;) {
    UINTN size = sizeof(infoBuffer);
    if (EFI_ERROR(directory->Read(directory, &size, infoBuffer)) || size == 0) {
      break;
    }
    const bool dot = info->FileName[0] == u'.' &&
                     (info->FileName[1] == 0 || (info->FileName[1] == u'.' && info->FileName[2] == 0));
    if ((info->Attribute & EFI_FILE_DIRECTORY) == 0 || dot || depth >= kWarmDepth) {
      continue;
    }
    EFI_FILE_PROTOCOL *child = nullptr;
    if (!EFI_ERROR(directory->Open(directory, &child, info->FileName, EFI_FILE_MODE_READ, 0))) {
      directories += WarmDirectory(child, depth + 1);
      child->Close(child);
    }
  }
  return directories;
}

}  // namespace

UINTN MemoryWarmDirectoryCache(EFI_FILE_PROTOCOL *root) {
  return WarmDirectory(root, 0);
}

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
