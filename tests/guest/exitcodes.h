// How a run of the reference kernel ends: the byte it writes to the
// debug-exit port, after which the machine's exit status is (code << 1) | 1.
// The codes lie apart from the platform layer's (platform/exitcodes.h), and
// each constant stays on one line of the same form,
// `constexpr UINT8 kExitName = 0x..;`, so that the test harness reads both
// headers the same way.
#pragma once

#include <stdint.h>

namespace nimb::guest {

typedef uint8_t UINT8;

// Every check of the kernel passed, or at least one failed.
constexpr UINT8 kExitKernelPass = 0x31;
constexpr UINT8 kExitKernelFail = 0x32;

}  // namespace nimb::guest
