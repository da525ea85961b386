// What the kernel checks about its boot: only what holds in every boot. Facts
// that depend on how the machine was booted (the command line, the video
// mode, the names in the tree) are reported, and the harness compares them
// with what its scenario expects.
#pragma once

#include <stdint.h>

#include "bootargs.h"
#include "entry.h"

namespace nimb::guest {

// A stretch of memory that the loader handed over: the kernel's image, the
// boot record, the tree, the memory map, or a range of /chosen/memory-map.
struct Area {
  const char *name;
  uint32_t address;
  uint32_t length;
};

constexpr uint32_t kMaxAreas = 64;

// The kernel region as BootArgs describes it: everything handed over lies
// in [base, runtimeStart), the moved runtime services in [runtimeStart,
// end), the last two pages of which are spare.
struct KernelRegion {
  uint64_t base;
  uint64_t runtimeStart;
  uint64_t end;
};

KernelRegion KernelRegionOf(const BootArgs &args);

void CheckEntryState(const EntryState &state);

// Reports the record's fields and checks them; null when it can't be read.
const BootArgs *CheckBootArgs(uint32_t address);

// Prints the tree and checks its form and its fixed content; false when the
// tree can't be walked to its end.
bool CheckDeviceTree(const BootArgs &args);

// Adds the ranges of /chosen/memory-map to `areas` and checks them.
void CheckMemoryRanges(const BootArgs &args, const KernelRegion &region, Area *areas, uint32_t *count);

// Checks that the handed-over areas lie below the runtime area, inside the
// region, and apart from each other.
void CheckLayout(const KernelRegion &region, const Area *areas, uint32_t count, uint32_t fixedCount);

void CheckSystemTable(const BootArgs &args, const KernelRegion &region);
// The same for a system table at `systemTable`, its runtime services
// expected in [region.runtimeStart, region.end).
void CheckSystemTableAt(uint32_t systemTable, const KernelRegion &region);

// The whole report, from "kernel: start" to the result line; true for pass.
bool ReportBoot(const EntryState &state);

}  // namespace nimb::guest
