// The reference kernel: it reports what it was handed on the serial port,
// checks what every boot must hold, waits if its command line asks it to
// (hold.h), and ends the run with an exit code that says pass or fail
// (exitcodes.h).
#include <stddef.h>
#include <stdint.h>

#include "checks.h"
#include "entry.h"
#include "exitcodes.h"
#include "hold.h"
#include "memory.h"
#include "report.h"
#include "serial.h"

extern "C" [[noreturn]] void KernelMain(const nimb::guest::EntryState *state) {
  using namespace nimb::guest;
  SerialInit();
  // The loader's last message may have no line feed.
  ReportOutput('\n');
  bool pass = ReportBoot(*state);
  const uint8_t *record = GuestMemory(state->eax, sizeof(BootArgs));
  if (record != nullptr) {
    const BootArgs &args = *reinterpret_cast<const BootArgs *>(record);
    uint32_t seconds = HoldSeconds(args.commandLine, sizeof(args.commandLine));
    if (seconds != 0) {
      Line("hold %u s", seconds);
      Hold(seconds);
    }
  }
  PowerOff(pass ? kExitKernelPass : kExitKernelFail);
}
