#include "kernel_view.h"

#include <cstdio>
#include <string>

#include "checks.h"
#include "hostfw/hostfw.h"
#include "memory.h"
#include "memorymap.h"
#include "report.h"

namespace nimb::guest {

namespace {

// The kernel begins every line of its report with this; on the host the
// whole output is the report, and the prefix only gets in the way.
constexpr char kLinePrefix[] = "kernel: ";

std::string gLine;

}  // namespace

void ReportOutput(char character) {
  if (character != '\n') {
    gLine.push_back(character);
    return;
  }
  const size_t skip =
      gLine.compare(0, sizeof(kLinePrefix) - 1, kLinePrefix) == 0 ? sizeof(kLinePrefix) - 1 : 0;
  std::printf("%s\n", gLine.c_str() + skip);
  gLine.clear();
}

// The firmware's arena stands for physical memory and is mapped at the same
// addresses in this process; nothing outside it is the machine's.
const uint8_t *GuestMemory(uint32_t address, uint32_t length) {
  if (address < hostfw::kArenaBase || address >= hostfw::kArenaLimit ||
      length > hostfw::kArenaLimit - address) {
    return nullptr;
  }
  return reinterpret_cast<const uint8_t *>(static_cast<uintptr_t>(address));
}

}  // namespace nimb::guest

namespace dryboot {

// The kernel's report without the state at entry, which on the host is
// nobody's: the processor never leaves this program.
bool PrintKernelView(uint32_t bootArgs, uint32_t entry, const std::vector<KernelSegment> &segments) {
  using namespace nimb::guest;
  ReportReset();
  bool inCode = false;
  for (const KernelSegment &s : segments)
    inCode |= s.fileSize != 0 && entry >= s.address && entry - s.address < s.fileSize;
  Check("kernel-entry", entry != 0 && inCode, "entry=0x%x, wanted inside a segment's file bytes", entry);
  const BootArgs *args = CheckBootArgs(bootArgs);
  if (args != nullptr) {
    KernelRegion region = KernelRegionOf(*args);
    Area areas[kMaxAreas];
    uint32_t count = 0;
    areas[count++] = Area{"BootArgs", bootArgs, static_cast<uint32_t>(sizeof(BootArgs))};
    areas[count++] = Area{"device tree", args->deviceTree, args->deviceTreeLength};
    areas[count++] = Area{"memory map", args->memoryMap, args->memoryMapSize};
    const uint32_t fixedCount = count;
    if (CheckDeviceTree(*args)) {
      CheckMemoryRanges(*args, region, areas, &count);
    }
    CheckLayout(region, areas, count, fixedCount);
    // What the loader hands over lies outside every segment's memory, the
    // zero-filled part and segments without file bytes included.
    for (uint32_t i = 0; i < count; i++) {
      for (const KernelSegment &s : segments) {
        const uint64_t end = uint64_t{s.address} + s.memorySize;
        const bool apart =
            uint64_t{areas[i].address} + areas[i].length <= s.address || areas[i].address >= end;
        if (!apart) {
          Check("outside-kernel-segments", false, "%s at 0x%x lies in the segment at 0x%x of 0x%x bytes",
                areas[i].name, areas[i].address, s.address, s.memorySize);
        }
      }
    }
    CheckMemoryMap(*args, region, areas, count);
    CheckSystemTable(*args, region);
  }
  return ReportResult();
}

}  // namespace dryboot
