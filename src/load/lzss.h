// The LZSS stream of the kernel cache: a ring of 4096 bytes, pre-filled with
// spaces, written from position 4078; eight items per flags byte (bit set: a
// literal byte, bit clear: a two-byte reference of 3 to 18 bytes into the
// ring); no end marker.
#pragma once

#include "efi/efi.h"

namespace nimb {

constexpr UINT32 kLzssRingSize = 4096;
constexpr UINT32 kLzssRingStart = 4078;  // first write position; 0 .. 4077 hold spaces
constexpr UINT32 kLzssMinMatch = 3;
constexpr UINT32 kLzssMaxMatch = 18;

// Decodes the `length` bytes at `source` into `destination`, writing at most
// `capacity` bytes: a stream that would produce more stops there. Returns the
// number of bytes decoded. The ring starts afresh at every call. One pass,
// no allocation; bytes of the destination behind the count returned may
// have been written too.
UINT64 DecompressLzss(UINT8 *destination, UINT64 capacity, const UINT8 *source, UINT32 length);

}  // namespace nimb
