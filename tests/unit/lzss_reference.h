// The kernel cache's LZSS stream decoded as plainly as it is defined: one
// byte at a time through a ring of 4096, at most `capacity` bytes. The unit
// tests and the fuzz target hold the loader's decoder against it.
#pragma once

#include <cstddef>
#include <cstdint>
#include <vector>

namespace nimbtest {

using Bytes = std::vector<uint8_t>;

inline Bytes LzssReferenceDecode(const Bytes &stream, size_t capacity) {
  uint8_t ring[4096];
  for (unsigned i = 0; i < 4096; i++)
    ring[i] = i < 4078 ? ' ' : 0;
  Bytes out;
  unsigned write = 4078;
  auto put = [&](uint8_t byte) {
    out.push_back(byte);
    ring[write] = byte;
    write = (write + 1) % 4096;
  };
  size_t at = 0;
  while (at < stream.size()) {
    const unsigned flags = stream[at++];
    for (unsigned item = 0; item < 8; item++) {
      if (flags >> item & 1) {
        if (at == stream.size() || out.size() == capacity)
          return out;
        put(stream[at++]);
        continue;
      }
      if (stream.size() - at < 2)
        return out;
      const unsigned position = stream[at] | (stream[at + 1] & 0xF0) << 4;
      const unsigned count = (stream[at + 1] & 0x0F) + 3;
      at += 2;
      for (unsigned k = 0; k < count; k++) {
        if (out.size() == capacity)
          return out;
        put(ring[(position + k) % 4096]);
      }
    }
  }
  return out;
}

}  // namespace nimbtest
