// The platform layer's reports: written straight to the first serial port,
// line by line, so that they never mix with the escape sequences of the
// firmware's terminal emulation on the same port.
#pragma once

#include <stdarg.h>

#include "efi/efi.h"

namespace nimb::platform {

// Formats as FormatText does and writes the text to COM1, a line feed going
// out as CR LF.
void SerialPrintf(const char *format, ...);
void SerialPrintv(const char *format, va_list arguments);
// Writes UCS-2 text as it stands, a byte a unit; units beyond ASCII as '?'.
void SerialWriteText(const CHAR16 *text);

// The port's line status and transmit registers as the reports reach them:
// the machine's COM1, or a host test's stand-ins.
struct SerialPortIo {
  UINT8 (*readLineStatus)();
  void (*writeData)(UINT8 byte);
};
extern SerialPortIo gSerialPortIo;

// Port I/O for the machine's own devices.
inline void PortWriteByte(UINT16 port, UINT8 value) {
  __asm__ volatile("outb %0, %1" : : "a"(value), "Nd"(port));
}

inline UINT8 PortReadByte(UINT16 port) {
  UINT8 value;
  __asm__ volatile("inb %1, %0" : "=a"(value) : "Nd"(port));
  return value;
}

}  // namespace nimb::platform
