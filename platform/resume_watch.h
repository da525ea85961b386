// What the platform layer watches for the resume path: the count of starts
// on one variable store, the loader's resume variables as each start finds
// them, the reads of the loader through DiskIO and its call of ResetSystem,
// and a timed DiskIO read for the benchmark.
#pragma once

#include "config.h"
#include "efi/efi.h"

namespace nimb::platform {

// The count of this start in the run, from 1; prints "platform: boot N". A
// run is the starts on one variable store linked by resets that the loader
// asked for (before boot services end): the count stays in a variable of the
// platform's own from such a reset to the next start only. A store that refuses the variable counts
// every start as the first.
UINT32 CountBoot();

// Prints "platform: nvram at start: boot-signature=absent boot-image=58
// boot-image-key=absent": the size of each resume variable, or absent.
void ReportResumeVariables();

// When `variables` set boot-image-key: every place in memory where its bytes
// stand now, apart from the configuration's own copy, with the memory type
// ("platform: key copy at 0x<hex> type <n>"). These are the firmware's
// copies; a copy found after a resume anywhere else is the loader's.
void ReportKeyCopies(const ConfigEntryList &variables);

// Wraps ReadDisk of every DiskIO interface and the runtime services'
// ResetSystem: every read is logged, and a reset prints the log before it
// goes to the firmware ("platform: reset cold", "platform: read ...",
// "platform: reads N, bytes B"). With `timeReads`, each read also prints the
// counter at its start and end ("platform: tsc read-begin=",
// "platform: tsc read-end=") as it returns, and each GetMemoryMap call
// the counter as it starts ("platform: tsc memory-map=").
void WatchDiskAndReset(bool timeReads);
// Puts back what WatchDiskAndReset wrapped, before the platform leaves.
void UnwatchDiskAndReset();

// Reads the extents of `request` (u32 partition number, then u64 start and
// u64 length pairs, little-endian) through the firmware's DiskIO on that
// partition into one buffer, and prints the time it took in TSC ticks:
// "platform: timed read B bytes, N extents, T ticks".
void TimedRead(const ConfigBytes &request);

}  // namespace nimb::platform
