#include "memory/kernel_region.h"

#include "devicetree/devicetree.h"
#include "memory/tracking.h"
#include "screen/console.h"
#include "support/strings.h"

namespace nimb {

UINT64 gKernelRegionTop = 0;
UINT64 gKernelRegionBase = 0xFFFFFFFF;
DeviceTreeNode *gMemoryMapNode = nullptr;

// The region lies below 4 GiB: its addresses cross to the kernel as 32-bit
// words.
constexpr UINT64 kKernelRegionLimit = 0x100000000ULL;

UINT64 AllocateKernelPages(UINT64 *address, UINT64 *size) {
  // Counted so that no size overflows.
  UINT64 pages = (*size >> EFI_PAGE_SHIFT) + ((*size & (EFI_PAGE_SIZE - 1)) != 0 ? 1 : 0);
  // A range that would reach past the limit is refused as the firmware
  // refuses memory it has not.
  const bool fits = *size <= kKernelRegionLimit && *address <= kKernelRegionLimit - *size;
  EFI_PHYSICAL_ADDRESS placed = *address;
  EFI_STATUS status =
      fits ? TrackedAllocatePages(AllocateAddress, EfiLoaderData, static_cast<UINTN>(pages), &placed)
           : EFI_OUT_OF_RESOURCES;
  if (EFI_ERROR(status)) {
    printf("Error allocating 0x%x pages at 0x%x alloc type %d\n", static_cast<UINT32>(pages),
           static_cast<UINT32>(*address), static_cast<INT32>(AllocateAddress));
    return 0;
  }
  *address = placed;
  *size = pages << EFI_PAGE_SHIFT;
  return placed;
}

UINT64 AllocateKernelRegion(UINT64 *size) {
  UINT64 address = gKernelRegionTop;
  UINT64 result = AllocateKernelPages(&address, size);
  if (result != 0) {
    gKernelRegionTop += *size;
  }
  return result;
}

// The kernel reads each range as a property of /chosen/memory-map named after
// the range, whose 8 bytes are its address and length, 32 bits each,
// little-endian. `type` has no place there.
EFI_STATUS AddMemoryRange(const char *name, UINT64 address, UINT64 length, UINT32 type) {
  (void)type;
  // Property names are kept by pointer, so the name needs a home of its own.
  UINT32 nameSize = strlen(name) + 1;
  char *nameCopy = static_cast<char *>(TrackedAllocatePool(nameSize));
  if (nameCopy == nullptr) {
    return EFI_OUT_OF_RESOURCES;
  }
  memcpy(nameCopy, name, nameSize);
  UINT8 value[8];
  for (UINTN i = 0; i < 4; i++) {
    value[i] = static_cast<UINT8>(address >> (8 * i));
    value[4 + i] = static_cast<UINT8>(length >> (8 * i));
  }
  // A property that cannot be added goes unnoticed, as every other one does.
  DeviceTreeAddProperty(gMemoryMapNode, nameCopy, sizeof(value), value, 1);
  return EFI_SUCCESS;
}

}  // namespace nimb
