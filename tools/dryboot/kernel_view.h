// What the kernel is handed, as the reference kernel reports it: the boot
// record, the device tree, the ranges of /chosen/memory-map, the memory map
// and the firmware's tables, with the checks that hold for every boot. The
// reference kernel's own walkers do the work; here they read the host
// firmware's memory and print to standard output.
#pragma once

#include <cstdint>

namespace dryboot {

// Prints the report for the record at `bootArgs` (an address inside the
// host firmware's arena); true when every check passed.
bool PrintKernelView(uint32_t bootArgs);

}  // namespace dryboot
