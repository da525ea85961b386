// The C symbols that the compiler calls on its own in a freestanding build:
// block copies and clears of structures and arrays, and the marker that
// floating point is in use. They are string instructions in inline assembly,
// so the compiler can never turn their bodies back into calls of themselves.
#include <stddef.h>
#include <stdint.h>

extern "C" {

// Referenced by any object that touches floating point on this target.
int _fltused = 0;

void *memset(void *destination, int value, size_t count) {
  void *d = destination;
  __asm__ volatile("rep stosb" : "+D"(d), "+c"(count) : "a"(value) : "memory");
  return destination;
}

void *memcpy(void *destination, const void *source, size_t count) {
  void *d = destination;
  __asm__ volatile("rep movsb" : "+D"(d), "+S"(source), "+c"(count) : : "memory");
  return destination;
}

void *memmove(void *destination, const void *source, size_t count) {
  uint8_t *d = static_cast<uint8_t *>(destination);
  const uint8_t *s = static_cast<const uint8_t *>(source);
  if (d <= s || d >= s + count) {
    __asm__ volatile("rep movsb" : "+D"(d), "+S"(s), "+c"(count) : : "memory");
  } else {
    // The destination overlaps the source from above: copy downward, from
    // the last byte, and give the firmware its direction flag back clear.
    d += count - 1;
    s += count - 1;
    __asm__ volatile("std\n\trep movsb\n\tcld" : "+D"(d), "+S"(s), "+c"(count) : : "memory");
  }
  return destination;
}

int memcmp(const void *a, const void *b, size_t count) {
  const uint8_t *p = static_cast<const uint8_t *>(a);
  const uint8_t *q = static_cast<const uint8_t *>(b);
  for (size_t i = 0; i < count; i++) {
    if (p[i] != q[i]) {
      return p[i] < q[i] ? -1 : 1;
    }
  }
  return 0;
}

}  // extern "C"
