// The kernel's view of physical memory. In the kernel an address is a
// pointer (paging is off); the host test maps the addresses of a fake boot
// onto its own buffers. Values are read byte by byte, little-endian, so no
// read depends on alignment.
#pragma once

#include <stdint.h>

namespace nimb::guest {

// `length` bytes at the physical `address`, or null when they cannot be
// read: address 0, a range that wraps past 4 GiB, or (on the host) memory
// that the test did not provide.
const uint8_t *GuestMemory(uint32_t address, uint32_t length);

inline uint16_t Le16(const uint8_t *p) {
  return static_cast<uint16_t>(p[0] | p[1] << 8);
}

inline uint32_t Le32(const uint8_t *p) {
  return static_cast<uint32_t>(p[0]) | static_cast<uint32_t>(p[1]) << 8 | static_cast<uint32_t>(p[2]) << 16 |
         static_cast<uint32_t>(p[3]) << 24;
}

inline uint64_t Le64(const uint8_t *p) {
  return static_cast<uint64_t>(Le32(p)) | static_cast<uint64_t>(Le32(p + 4)) << 32;
}

// [start, start + size) lies within [low, high).
inline bool Inside(uint64_t start, uint64_t size, uint64_t low, uint64_t high) {
  return start >= low && start <= high && size <= high - start;
}

}  // namespace nimb::guest
