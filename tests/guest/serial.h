// The machine's ports as the kernel uses them: COM1 for the report, the
// debug-exit device to end the run.
#pragma once

#include <stdint.h>

namespace nimb::guest {

// Sets COM1 to 115200 baud, 8 data bits, no parity, one stop bit, no
// interrupts, as the firmware had it.
void SerialInit();

// Writes `code` to the debug-exit port; without that device, halts for good.
[[noreturn]] void PowerOff(uint8_t code);

}  // namespace nimb::guest
