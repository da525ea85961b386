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

namespace nimb::guest {

// Paging is off: an address is the memory itself.
const uint8_t *GuestMemory(uint32_t address, uint32_t length) {
  if (address == 0 || length > 0xFFFFFFFFu - address + 1) {
    return nullptr;
  }
  return reinterpret_cast<const uint8_t *>(static_cast<uintptr_t>(address));
}

}  // namespace nimb::guest

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

// The compiler may call these for copies and clears of aggregates; written
// with string instructions so that they can't turn into calls to themselves.
extern "C" void *memcpy(void *destination, const void *source, size_t count) {
  void *result = destination;
  __asm__ volatile("rep movsb" : "+D"(destination), "+S"(source), "+c"(count) : : "memory");
  return result;
}

extern "C" void *memset(void *destination, int value, size_t count) {
  void *result = destination;
  __asm__ volatile("rep stosb" : "+D"(destination), "+c"(count) : "a"(value) : "memory");
  return result;
}
