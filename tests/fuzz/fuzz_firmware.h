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

}  // namespace nimbfuzz
