// Any bytes as a kernel image in memory: finding the slice and loading the
// object must stay inside the file and inside the pages the loader took,
// and end; whatever it took must all come back.

#include "fuzz_firmware.h"
#include "load/bootfile.h"
#include "load/kernel.h"
#include "memory/kernel_region.h"

// The memory a kernel may take per input.
constexpr UINT64 kUsableMemory = 32ull << 20;

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  static hostfw::Firmware &fw = nimbfuzz::Quiet(*new hostfw::Firmware, kUsableMemory);
  nimbfuzz::AttachLoader(fw);
  nimb::gKernelRegionBase = 0xFFFFFFFF;
  nimb::gKernelRegionTop = 0;
  nimb::gKernelEntry = 0x5EED;
  Check(fw.LivePoolBlocks() == 0 && fw.AllocatedPages() == 0);

  // A heap copy of exactly the input, so that a read past its end shows.
  std::vector<uint8_t> bytes(data, data + size);
  uint8_t none = 0;
  nimb::BootFile file = {};
  file.buffer = size == 0 ? &none : bytes.data();
  file.size = size;

  UINT64 sliceSize = 0;
  UINT64 sliceOffset = 0;
  EFI_STATUS status = nimb::BootFileFindSlice(&file, &sliceSize, &sliceOffset);
  // The slice is the declared one and may run past the end of the file (its
  // reads come short); one that starts past the end cannot be positioned.
  if (status == EFI_SUCCESS) {
    Check(sliceSize != 0 && sliceOffset <= size);
  } else {
    Check(status == EFI_LOAD_ERROR || status == EFI_INVALID_PARAMETER);
  }

  file.position = 0;
  status = nimb::LoadKernel(&file);
  if (status == EFI_SUCCESS) {
    Check(nimb::gKernelEntry <= 0x3FFFFFFF);
    Check(nimb::gKernelRegionTop <= 0x100000000ull);
    if (fw.AllocatedPages() != 0)
      Check(nimb::gKernelRegionBase < nimb::gKernelRegionTop);
  } else {
    Check(nimb::gKernelEntry == 0x5EED);
  }

  // Only the pages of segments are kept; the commands buffer went back.
  for (const nimb::MemoryTag *tag = nimb::gMemoryTags; tag != nullptr; tag = tag->next)
    Check(tag->poolAddress == nullptr);
  nimbfuzz::FinishInput(fw);
  return 0;
}
