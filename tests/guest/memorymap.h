// The firmware's memory map as the loader hands it over: walked by the
// descriptor size that BootArgs gives, summarised by type, and checked for
// the moved runtime services.
#pragma once

#include <stdint.h>

#include "bootargs.h"
#include "checks.h"

namespace nimb::guest {

// Name of a memory type, "EfiConventionalMemory" and so on; null for a type
// the firmware standard doesn't define.
const char *MemoryTypeName(uint32_t type);

// Prints the summary and checks the map; `areas` must all lie in
// EfiLoaderData memory.
void CheckMemoryMap(const BootArgs &args, const KernelRegion &region, const Area *areas, uint32_t count);

}  // namespace nimb::guest
