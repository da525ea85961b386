// The time stamp counter, for timings that run across the platform layer,
// the loader and the kernel in one boot: each side reports its moments as
// counter values on the serial port (the platform as
// "platform: tsc <moment>=0x<hex>", the reference kernel as
// "kernel: tsc entry=0x<hex>"), and a script takes the differences. Under
// TCG the counter follows virtual time, so only ratios within one run mean
// anything.
#pragma once

#include "efi/efi.h"

namespace nimb::platform {

inline UINT64 ReadTsc() {
  UINT32 low = 0;
  UINT32 high = 0;
  __asm__ volatile("rdtsc" : "=a"(low), "=d"(high));
  return static_cast<UINT64>(high) << 32 | low;
}

// "platform: tsc <moment>=0x<hex>" on a line of its own.
void ReportTsc(const char *moment, UINT64 tsc);

}  // namespace nimb::platform
