// Conversions between UTF-8 (configuration files, the device tree) and UCS-2
// (the firmware's names, files and variables).
#pragma once

#include "efi/efi.h"

namespace nimb {

// `units` UCS-2 units from `source` into `destination`, which always ends in
// a NUL unless `destinationSize` is 0. Zero units are dropped; a character
// that does not fit ends the conversion whole. `byteOrder` 2 means the units
// are byte-swapped.
void UcsToUtf8(const UINT16 *source, INT32 units, UINT8 *destination, UINT32 destinationSize, UINT32 byteOrder);
// NUL-terminated UTF-8 into at most `maxUnits` units and a NUL unit, into
// a buffer of `destinationBytes` bytes; `*unitCount` gets the units written.
// Malformed input stops the conversion.
void Utf8ToUcs(const UINT8 *source, UINT64 maxUnits, UINT16 *destination, UINT64 *unitCount,
               UINT64 destinationBytes);
// Tracked buffer of 3 * StrLen(text) + 1 bytes; null when out of memory.
char *UcsToUtf8Alloc(const CHAR16 *text);
// Tracked buffer of 4 * strlen(text) + 2 bytes holding a terminated text of
// at most `maxUnits` units; null when out of memory.
CHAR16 *Utf8ToUcsAlloc(const char *text, UINT64 maxUnits);

}  // namespace nimb
