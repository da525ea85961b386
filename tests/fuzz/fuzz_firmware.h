// The host firmware that a fuzz target runs the loader over: one for the
// whole run (making one per input costs far more than the input), with the
// loader's tables pointed at it and its memory tracking empty at the start
// of each input.
#pragma once

#include "boot/boot.h"
#include "hostfw/hostfw.h"
#include "memory/tracking.h"

namespace nimbfuzz {

inline void AttachLoader(hostfw::Firmware &fw) {
  nimb::gST = fw.SystemTable();
  nimb::gBS = fw.BootServices();
  nimb::gRT = fw.RuntimeServices();
  nimb::gImageHandle = fw.ImageHandle();
  nimb::gMemoryTags = nullptr;
  nimb::gFreeMemoryTags = nullptr;
  nimb::gMemoryTagBlocks = nullptr;
}

// The loader's tables cleared again at the end of an input.
inline void DetachLoader() {
  nimb::gST = nullptr;
  nimb::gBS = nullptr;
  nimb::gRT = nullptr;
  nimb::gImageHandle = nullptr;
}

// Declares all free memory of the arena above its first `bytes` reserved,
// so that an input asking for a gigabyte is refused at once instead of
// being filled byte by byte on every run.
inline void LimitUsableMemory(hostfw::Firmware &fw, UINT64 bytes) {
  const UINT64 cut = hostfw::kArenaBase + bytes;
  for (const EFI_MEMORY_DESCRIPTOR &d : fw.MemoryMap()) {
    UINT64 start = d.PhysicalStart;
    const UINT64 end = start + d.NumberOfPages * EFI_PAGE_SIZE;
    if (d.Type != EfiConventionalMemory || end <= cut)
      continue;
    if (start < cut)
      start = cut;
    fw.AddMemoryRegion(EfiReservedMemoryType, start, (end - start) / EFI_PAGE_SIZE, 0);
  }
}

}  // namespace nimbfuzz
