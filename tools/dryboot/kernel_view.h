// What the kernel is handed, as the reference kernel reports it: the boot
// record, the device tree, the ranges of /chosen/memory-map, the memory map
// and the firmware's tables, with the checks that hold for every boot. The
// reference kernel's own walkers do the work; here they read the host
// firmware's memory and print to standard output.
#pragma once

#include <cstdint>
#include <vector>

#include "kernel_image.h"

namespace dryboot {

// Prints the report for the record at `bootArgs` (an address inside the
// host firmware's arena), for a kernel entered at `entry` whose object has
// `segments`; true when every check passed. Beyond the reference kernel's
// own checks: the entry is not 0 and lies in a segment with file bytes, and
// nothing the loader hands over lies in the memory of a segment.
bool PrintKernelView(uint32_t bootArgs, uint32_t entry, const std::vector<KernelSegment> &segments);

}  // namespace dryboot
