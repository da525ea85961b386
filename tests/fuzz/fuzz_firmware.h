// The host firmware that a fuzz target runs the loader over: one for the
// whole run (making one per input costs far more than the input), with the
// loader's tables pointed at it and its memory tracking empty at the start
// of each input.
#pragma once

#include <fuzzer/FuzzedDataProvider.h>
#include <stdlib.h>

#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <memory>
#include <string>
#include <vector>

#include "boot/boot.h"
#include "hostfw/hostfw.h"
#include "memory/tracking.h"

namespace nimbfuzz {

inline void Check(bool condition) {
  if (!condition)
    abort();
}

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

// The end of an input: all the loader took given back (the pages too, with
// `pages`), and its tables cleared.
inline void FinishInput(hostfw::Firmware &fw, bool pages = true) {
  nimb::TrackedFreeAll();
  Check(fw.LivePoolBlocks() == 0 && (!pages || fw.AllocatedPages() == 0));
  DetachLoader();
}

// Declares all of the arena above its first `usable` bytes reserved, so that
// a segment or block of a gigabyte is refused at once instead of being
// filled byte by byte on every run.
inline void LimitUsableMemory(hostfw::Firmware &fw, UINT64 usable) {
  UINT64 cut = hostfw::kArenaBase + usable;
  for (const EFI_MEMORY_DESCRIPTOR &d : fw.MemoryMap()) {
    UINT64 start = d.PhysicalStart;
    UINT64 end = start + d.NumberOfPages * EFI_PAGE_SIZE;
    if (d.Type != EfiConventionalMemory || end <= cut)
      continue;
    if (start < cut)
      start = cut;
    fw.AddMemoryRegion(EfiReservedMemoryType, start, (end - start) / EFI_PAGE_SIZE, 0);
  }
}

// A firmware for the whole run, quiet (messages would pile up in its records
// over millions of runs), with its usable memory limited when `usable` is set.
inline hostfw::Firmware &Quiet(hostfw::Firmware &fw, UINT64 usable = 0) {
  fw.SetConOutPresent(false);
  fw.SetStdErrPresent(false);
  if (usable != 0)
    LimitUsableMemory(fw, usable);
  return fw;
}

// A firmware for targets that read files: quiet (messages would pile up in
// its records over millions of runs), with the usable memory limited, and
// a directory volume over a fresh host directory whose root stays open.
struct VolumeMachine {
  hostfw::Firmware fw;
  std::string directory;
  EFI_HANDLE device = nullptr;
  EFI_FILE *root = nullptr;

  VolumeMachine() {
    Quiet(fw, 32ull << 20);
    char pattern[] = "/tmp/nimb-fuzz-XXXXXX";
    directory = mkdtemp(pattern);
    device = fw.AddDirectoryVolume(directory);
    EFI_SIMPLE_FILE_SYSTEM_PROTOCOL *fileSystem = nullptr;
    fw.BootServices()->HandleProtocol(device, &gEfiSimpleFileSystemProtocolGuid,
                                      reinterpret_cast<void **>(&fileSystem));
    if (fileSystem == nullptr || EFI_ERROR(fileSystem->OpenVolume(fileSystem, &root)))
      abort();
  }
};

}  // namespace nimbfuzz

// For a target whose firmware records every file name opened: each input
// then leaves heap behind it, and libFuzzer would scan the whole arena for
// leaks after each. The loader's own memory is checked by the firmware's
// counts instead.
#define NIMB_FUZZ_WITHOUT_LEAK_SCAN                              \
  extern "C" int LLVMFuzzerInitialize(int *argc, char ***argv) { \
    static std::vector<char *> arguments(*argv, *argv + *argc);  \
    static char noLeaks[] = "-detect_leaks=0";                   \
    arguments.insert(arguments.end(), {noLeaks, nullptr});       \
    *argc += 1;                                                  \
    *argv = arguments.data();                                    \
    return 0;                                                    \
  }

using nimbfuzz::Check;
