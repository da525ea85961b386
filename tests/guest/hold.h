// The kernel's own option: `guest.hold=N` on the command line makes it wait
// N seconds before it powers the machine off, so that the screen can be
// looked at as the loader left it.
#pragma once

#include <stdint.h>

namespace nimb::guest {

constexpr uint32_t kMaxHoldSeconds = 600;

// The seconds that the first `guest.hold=` word of the command line asks
// for, at most kMaxHoldSeconds; 0 without such a word or when its value
// isn't all decimal digits. Words are separated by blanks (space, tab, CR,
// LF); at most `length` bytes of `commandLine` are read, up to a NUL.
uint32_t HoldSeconds(const char *commandLine, uint32_t length);

// Busy-waits `seconds` on the PIT's channel 2 (the kernel has no interrupts).
void Hold(uint32_t seconds);

}  // namespace nimb::guest
