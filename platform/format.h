// A small formatter for the platform layer's own reports, which go to the
// serial port, and the names of firmware status codes.
#pragma once

#include <stdarg.h>

#include "efi/efi.h"

namespace nimb::platform {

typedef void (*FormatOutput)(char character, void *context);

// Directives: %s (8-bit string; null prints "(null)"), %u (UINT64, decimal),
// %x (UINT64, lower-case hexadecimal), %c (int, one character), %% (a percent
// sign). Every integer argument is passed as UINT64. A directive not in this
// list is printed as it stands.
void FormatText(FormatOutput output, void *context, const char *format, va_list arguments);

// Formats into `buffer` of `size` bytes, cutting at its end; always ends in a
// NUL when `size` is not 0. Returns the length of the text without the cut.
UINTN FormatToBuffer(char *buffer, UINTN size, const char *format, ...);
UINTN FormatToBufferv(char *buffer, UINTN size, const char *format, va_list arguments);

// "EFI_SUCCESS", "EFI_ABORTED" and so on; "unknown status" for others.
const char *StatusName(EFI_STATUS status);

}  // namespace nimb::platform
