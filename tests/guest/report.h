// The kernel's report on the serial port. Every line begins with "kernel: ";
// a harness picks the lines out of the rest of the serial log and reads them:
//
//   kernel: start
//   kernel: entry <register>=0x<hex> ...              the state at entry
//   kernel: tsc entry=0x<hex>                          time stamp counter at entry
//   kernel: check <name> ok|FAIL[ <detail>]            one per check
//   kernel: bootargs <field>=<value>                   one per BootArgs field
//   kernel: tree <indent><line>                        the device tree
//   kernel: memmap <summary>                           the memory map
//   kernel: range <name> address=0x<hex> length=0x<hex>
//   kernel: efi <field>=<value> ...                    the firmware's tables
//   kernel: result pass|fail (<n> checks, <m> failed)  the end of the report
//   kernel: hold <n> s                                  guest.hold=<n>: waiting
//   kernel: driver ..., package ..., drivers ...       what came of drivers (drivers.h)
//
// Numbers are C literals: hexadecimal with 0x, or decimal. Text values stand
// between double quotes, with \" and \\ escaped and any byte outside
// printable ASCII written as \xNN.
#pragma once

#include <stdarg.h>
#include <stdint.h>

#define GUEST_PRINTF(formatIndex, firstArgument) __attribute__((format(printf, formatIndex, firstArgument)))

namespace nimb::guest {

// Where the report's characters go; a line ends in '\n'. The kernel writes
// to the serial port, the host test into a string.
void ReportOutput(char character);

// Directives: %s, %c, %d, %u and %x (32-bit), %llx (64-bit), with an
// optional 0 flag and width, and %%.
void Print(const char *format, ...) GUEST_PRINTF(1, 2);
void PrintV(const char *format, va_list arguments);

// A whole line: the prefix, the text and the line feed.
void Line(const char *format, ...) GUEST_PRINTF(1, 2);
void LineStart();
void LineEnd();

// At most `length` bytes of `text`, up to a NUL, quoted as described above.
void PrintQuoted(const char *text, uint32_t length);
// One byte of such a text, escaped as needed, without the quotes.
void PrintTextByte(uint8_t byte);

// Reports one check and counts it; returns `ok`. The detail says what was
// found, and for a failure what was wanted.
bool Check(const char *name, bool ok, const char *format, ...) GUEST_PRINTF(3, 4);

struct ReportCounts {
  uint32_t checks;
  uint32_t failed;
};
ReportCounts ReportCountsSoFar();
void ReportReset();

// Prints the result line; true when no check failed.
bool ReportResult();

}  // namespace nimb::guest
