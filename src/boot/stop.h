// The way out once boot services have ended. From ExitBootServices on, the
// console, the pool and Exit are gone, so Fatal cannot be used: what is left
// is the runtime services' reset and the processor itself.
#pragma once

#include "efi/efi.h"

namespace nimb {

// The message of the stop, kept in memory where a debugger attached to the
// stopped machine finds it; null until a stop.
extern const char *gStopMessage;

// Ends the run behind ExitBootServices without touching the console, the
// pool or any boot service. `message` is kept in gStopMessage. With `reset`
// non-zero and the runtime services at hand (gRT), the machine is reset cold
// through ResetSystem; otherwise, or should the reset come back, the
// processor halts. A failed resume asks for the reset: the next boot is a
// normal one. A normal boot halts, as a reset would most likely end in the
// same place again.
[[noreturn]] void StopAfterBootServices(const char *message, BOOLEAN reset);

}  // namespace nimb
