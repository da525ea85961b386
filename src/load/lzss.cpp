#include "load/lzss.h"

namespace nimb {

// The ring of the stream's format. Its bytes behind the spaces read as zero,
// at every call alike.
static UINT8 gLzssRing[kLzssRingSize];

UINT64 DecompressLzss(UINT8 *destination, UINT64 capacity, const UINT8 *source, UINT32 length) {
  for (UINT32 i = 0; i < kLzssRingStart; i++) {
    gLzssRing[i] = ' ';
  }
  for (UINT32 i = kLzssRingStart; i < kLzssRingSize; i++) {
    gLzssRing[i] = 0;
  }
  const UINT8 *end = source + length;
  UINT32 write = kLzssRingStart;
  UINT32 flags = 0;
  UINT64 written = 0;
  for (;;) {
    flags >>= 1;
    if ((flags & 0x100) == 0) {
      if (source == end) {
        break;
      }
      flags = *source++ | 0xFF00;
    }
    if (flags & 1) {
      if (source == end || written == capacity) {
        break;
      }
      const UINT8 byte = *source++;
      destination[written++] = byte;
      gLzssRing[write] = byte;
      write = (write + 1) & (kLzssRingSize - 1);
      continue;
    }
    if (end - source < 2) {
      break;
    }
    const UINT32 i = source[0], j = source[1];
    source += 2;
    const UINT32 position = i | ((j & 0xF0) << 4);
    const UINT32 count = (j & 0x0F) + kLzssMinMatch;
    for (UINT32 k = 0; k < count; k++) {
      if (written == capacity) {
        return written;
      }
      const UINT8 byte = gLzssRing[(position + k) & (kLzssRingSize - 1)];
      destination[written++] = byte;
      gLzssRing[write] = byte;
      write = (write + 1) & (kLzssRingSize - 1);
    }
  }
  return written;
}

}  // namespace nimb
