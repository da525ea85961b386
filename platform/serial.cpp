#include "serial.h"

#include "format.h"

namespace nimb::platform {

namespace {

// COM1, as the firmware has set it up: its transmit register and its line
// status register, whose bit 5 tells that the transmit register is empty.
constexpr UINT16 kSerialData = 0x3F8;
constexpr UINT16 kSerialLineStatus = 0x3FD;
constexpr UINT8 kTransmitEmpty = 0x20;
// A port without a UART reads as 0xFF, which passes the test at once; the
// bound (about a second on a real port) keeps a UART that never empties
// from hanging the run.
constexpr UINT32 kTransmitPolls = 1000000;

// Set once the transmit register stayed full for the whole bound: the port
// is given up for the rest of the run, so that the report costs no second a
// character.
bool gSerialGone;

void SerialWriteByte(UINT8 byte) {
  if (gSerialGone) {
    return;
  }
  for (UINT32 i = 0; (PortReadByte(kSerialLineStatus) & kTransmitEmpty) == 0; i++) {
    if (i == kTransmitPolls) {
      gSerialGone = true;
      return;
    }
  }
  PortWriteByte(kSerialData, byte);
}

void SerialOutput(char character, void *) {
  if (character == '\n') {
    SerialWriteByte('\r');
  }
  SerialWriteByte(static_cast<UINT8>(character));
}

}  // namespace

void SerialPrintv(const char *format, va_list arguments) {
  FormatText(SerialOutput, nullptr, format, arguments);
}

void SerialWriteText(const CHAR16 *text) {
  for (; *text != 0; text++) {
    SerialWriteByte(*text < 0x80 ? static_cast<UINT8>(*text) : static_cast<UINT8>('?'));
  }
}

void SerialPrintf(const char *format, ...) {
  va_list arguments;
  va_start(arguments, format);
  SerialPrintv(format, arguments);
  va_end(arguments);
}

}  // namespace nimb::platform
