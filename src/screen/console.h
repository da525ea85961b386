// Text output of the loader: the formatter, printf and its kin, the fatal
// way out, and the console's text or graphics mode.
#pragma once

#include <stdarg.h>

#include "efi/efi.h"

namespace nimb {

// Receives each character of formatted output; 8-bit characters arrive
// sign-extended.
typedef void (*PutCharFunction)(INT32 character, void *context);

// FormatEngine flags.
constexpr UINT32 kFormatBlank = 0x01;
constexpr UINT32 kFormatZeroPad = 0x02;
constexpr UINT32 kFormatUpperCase = 0x10;

void FormatEngine(const char *format, PutCharFunction putChar, void *context, va_list arguments);
void FormatNumber(UINT64 value, UINT32 base, UINT32 flags, UINT32 width, PutCharFunction putChar,
                  void *context);

int sprintf(char *buffer, const char *format, ...);
int printf(const char *format, ...);
int ErrorPrintf(const char *format, ...);
[[noreturn]] void Fatal(const char *format, ...);

// Console modes as SetConsoleMode takes them (not the protocol's values).
constexpr UINT32 kConsoleGraphics = 1;
constexpr UINT32 kConsoleText = 2;

extern EFI_CONSOLE_CONTROL_PROTOCOL *gConsoleControl;
extern UINT32 gConsoleMode;         // in the protocol's values
extern UINT32 gInitialConsoleMode;  // in the protocol's values

EFI_STATUS InitConsole();
EFI_STATUS SetConsoleMode(UINT32 mode);
EFI_STATUS RestoreConsoleMode();
void ConsolePutChar(INT32 character, void *context);

}  // namespace nimb
