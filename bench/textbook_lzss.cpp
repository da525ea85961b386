// The LZSS stream decoded as a textbook does it: a ring of 4096 bytes, one
// byte at a time through it. Compiled only with the firmware build's code
// generation, as the peer of the loader's decoder.
#include "routines.h"

namespace {

uint8_t gRing[4096];

}  // namespace

uint64_t TextbookLzss(uint8_t *destination, uint64_t capacity, const uint8_t *source, uint32_t length) {
  for (uint32_t i = 0; i < 4096; i++) {
    gRing[i] = i < 4078 ? ' ' : 0;
  }
  const uint8_t *end = source + length;
  uint32_t write = 4078, flags = 0;
  uint64_t written = 0;
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
      destination[written++] = gRing[write] = *source++;
      write = (write + 1) & 4095;
      continue;
    }
    if (end - source < 2) {
      break;
    }
    const uint32_t position = source[0] | (source[1] & 0xF0) << 4, count = (source[1] & 0x0F) + 3;
    source += 2;
    for (uint32_t k = 0; k < count; k++) {
      if (written == capacity) {
        return written;
      }
      destination[written++] = gRing[write] = gRing[(position + k) & 4095];
      write = (write + 1) & 4095;
    }
  }
  return written;
}
