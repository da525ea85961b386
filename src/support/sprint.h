// Wide formatting of path names for the firmware's file interfaces.
#pragma once

#include "efi/efi.h"

namespace nimb {

// Formats the UCS-2 `format` into `buffer` of `size` bytes, always ending in
// a NUL unit (unless `size` is below 2). Directives: %S (UCS-2 string),
// %a (8-bit string), %08x (exactly 8 upper-case hex digits). Returns the
// units written, the terminator counted.
UINTN SPrint(CHAR16 *buffer, UINTN size, const CHAR16 *format, ...);

}  // namespace nimb
