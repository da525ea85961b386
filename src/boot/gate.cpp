#include "boot/gate.h"

#include "boot/boot.h"
#include "memory/tracking.h"
#include "support/strings.h"

namespace nimb {

EFI_STATUS CopyCallGate() {
  // The gate runs with a 32-bit instruction pointer and paging off, so the
  // copy must lie below 4 GiB; the page is writable and executable, because
  // the gate fills in its own address fields.
  gCallGate = 0xFFFFFFFF;
  UINTN pages = (CallGateSize() + EFI_PAGE_SIZE - 1) / EFI_PAGE_SIZE;
  EFI_STATUS status = TrackedAllocatePages(AllocateMaxAddress, EfiLoaderCode, pages, &gCallGate);
  if (EFI_ERROR(status)) {
    return status;
  }
  memcpy(reinterpret_cast<void *>(gCallGate), CallGateStart, CallGateSize());
  return status;
}

}  // namespace nimb
