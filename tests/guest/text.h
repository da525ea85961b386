// The few string routines the kernel needs; it has no library.
#pragma once

#include <stdint.h>

namespace nimb::guest {

inline bool TextEqual(const char *a, const char *b) {
  while (*a != '\0' && *a == *b) {
    a++;
    b++;
  }
  return *a == *b;
}

inline bool StartsWith(const char *text, const char *prefix) {
  while (*prefix != '\0') {
    if (*text++ != *prefix++) {
      return false;
    }
  }
  return true;
}

// Length of `text` up to its NUL, or `limit` when there is none before it.
inline uint32_t TextLength(const char *text, uint32_t limit) {
  uint32_t length = 0;
  while (length < limit && text[length] != '\0') {
    length++;
  }
  return length;
}

}  // namespace nimb::guest
