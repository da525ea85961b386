// Byte-string, memory and UCS-2 string routines. Plain byte and unit loops,
// except where a routine is on a hot path: memset and memcpy go four words a
// step (the kernel cache's segments, the hand-off's move of the runtime
// regions), memcmp compares file headers a word at a time when it can.
#include "support/strings.h"

namespace nimb {

namespace {

// Word reads over buffers of any declared type.
typedef UINT64 __attribute__((may_alias)) AliasedUint64;
// The same at any address: x86 reads and writes words unaligned.
typedef UINT64 __attribute__((may_alias, aligned(1))) UnalignedUint64;
typedef UINT32 __attribute__((may_alias)) AliasedUint32;

// Characters compared as the signed bytes they are on this platform.
inline int SignedDifference(UINT8 a, UINT8 b) {
  return static_cast<int>(static_cast<INT8>(a)) - static_cast<int>(static_cast<INT8>(b));
}

}  // namespace

void *memset(void *destination, int value, UINTN count) {
  UINT8 *d = static_cast<UINT8 *>(destination);
  const UINT8 byte = static_cast<UINT8>(value);
  const UINT64 word = byte * 0x0101010101010101ull;
  UINTN i = 0;
  // Four words a step, then one, then the bytes that are left.
  for (; count - i >= 32; i += 32) {
    UnalignedUint64 *w = reinterpret_cast<UnalignedUint64 *>(d + i);
    w[0] = word;
    w[1] = word;
    w[2] = word;
    w[3] = word;
  }
  for (; count - i >= 8; i += 8) {
    *reinterpret_cast<UnalignedUint64 *>(d + i) = word;
  }
  for (; i < count; i++) {
    d[i] = byte;
  }
  return destination;
}

void *memcpy(void *destination, const void *source, UINTN count) {
  UINT8 *d = static_cast<UINT8 *>(destination);
  const UINT8 *s = static_cast<const UINT8 *>(source);
  UINTN i = 0;
  // Eight bytes a step wherever that gives the bytes of the upward byte loop:
  // when the destination lies below the source, or 8 bytes or more above it,
  // no word read takes in a byte that the same step writes.
  // Each word is read just before it is written, in this order, so that a
  // step of four words gives what four steps of one would.
  if (reinterpret_cast<UINTN>(d) - reinterpret_cast<UINTN>(s) >= 8) {
    for (; count - i >= 32; i += 32) {
      UnalignedUint64 *to = reinterpret_cast<UnalignedUint64 *>(d + i);
      const UnalignedUint64 *from = reinterpret_cast<const UnalignedUint64 *>(s + i);
      to[0] = from[0];
      to[1] = from[1];
      to[2] = from[2];
      to[3] = from[3];
    }
    for (; count - i >= 8; i += 8) {
      *reinterpret_cast<UnalignedUint64 *>(d + i) = *reinterpret_cast<const UnalignedUint64 *>(s + i);
    }
  }
  for (; i < count; i++) {
    d[i] = s[i];
  }
  return destination;
}

void *memmove(void *destination, const void *source, UINTN count) {
  UINT8 *d = static_cast<UINT8 *>(destination);
  const UINT8 *s = static_cast<const UINT8 *>(source);
  if (d <= s || d >= s + count) {
    return memcpy(destination, source, count);
  }
  while (count-- > 0) {
    d[count] = s[count];
  }
  return destination;
}

void bzero(void *destination, UINTN count) {
  memset(destination, 0, count);
}

void bcopy(const void *source, void *destination, UINTN count) {
  memcpy(destination, source, count);
}

int memcmp(const void *a, const void *b, UINTN count) {
  const UINT8 *p = static_cast<const UINT8 *>(a);
  const UINT8 *q = static_cast<const UINT8 *>(b);
  UINTN i = 0;
  if (((reinterpret_cast<UINTN>(p) | reinterpret_cast<UINTN>(q) | count) & 7) == 0) {
    // Skip equal words; the byte loop below then finds the difference inside
    // the first unequal one.
    while (i < count && *reinterpret_cast<const AliasedUint64 *>(p + i) ==
                            *reinterpret_cast<const AliasedUint64 *>(q + i)) {
      i += 8;
    }
  }
  for (; i < count; i++) {
    if (p[i] != q[i]) {
      return SignedDifference(p[i], q[i]);
    }
  }
  return 0;
}

UINT32 strlen(const char *text) {
  UINT32 length = 0;
  while (text[length] != '\0') {
    length++;
  }
  return length;
}

int strcmp(const char *a, const char *b) {
  while (*a != '\0' && *a == *b) {
    a++;
    b++;
  }
  return SignedDifference(static_cast<UINT8>(*a), static_cast<UINT8>(*b));
}

int strncmp(const char *a, const char *b, INT32 count) {
  for (INT32 i = 0; i < count; i++) {
    if (a[i] != b[i]) {
      return SignedDifference(static_cast<UINT8>(a[i]), static_cast<UINT8>(b[i]));
    }
    if (a[i] == '\0') {
      return 0;
    }
  }
  return 0;
}

char *strcpy(char *destination, const char *source) {
  UINTN i = 0;
  do {
    destination[i] = source[i];
  } while (source[i++] != '\0');
  return destination;
}

char *strncpy(char *destination, const char *source, UINTN count) {
  for (UINTN i = 0; i < count; i++) {
    destination[i] = source[i];
    if (source[i] == '\0') {
      break;
    }
  }
  return destination;
}

int strncasecmp(const char *a, const char *b, INT32 count) {
  for (INT32 i = 0; i < count; i++) {
    // Bit 5 is cleared in every character, so '[' matches '{' and a blank
    // matches a NUL; option keys rely on nothing finer.
    const UINT8 x = static_cast<UINT8>(a[i]) & 0xDF;
    const UINT8 y = static_cast<UINT8>(b[i]) & 0xDF;
    if (x != y) {
      return SignedDifference(x, y);
    }
    if (a[i] == '\0') {
      return 0;
    }
  }
  return 0;
}

UINT64 strtoul(const char *text, char **end, INT32 base) {
  const char *p = text;
  while (*p == ' ' || *p == '\t' || *p == '\n') {
    p++;
  }
  bool negative = false;
  if (*p == '-') {
    negative = true;
    p++;
  } else if (*p == '+') {
    p++;
  }
  if ((base == 0 || base == 16) && p[0] == '0' && (p[1] == 'x' || p[1] == 'X')) {
    p += 2;
    base = 16;
  } else if (base == 0) {
    base = (*p == '0') ? 8 : 10;
  }

  UINT64 value = 0;
  bool overflow = false;
  const char *digitsStart = p;
  // A base outside 2..36 has no digits, and the text reads as no number.
  while (base >= 2 && base <= 36) {
    const char c = *p;
    INT32 digit;
    if (c >= '0' && c <= '9') {
      digit = c - '0';
    } else if (c >= 'a' && c <= 'z') {
      digit = c - 'a' + 10;
    } else if (c >= 'A' && c <= 'Z') {
      digit = c - 'A' + 10;
    } else {
      break;
    }
    if (digit >= base) {
      break;
    }
    if (__builtin_mul_overflow(value, static_cast<UINT64>(base), &value) ||
        __builtin_add_overflow(value, static_cast<UINT64>(digit), &value)) {
      overflow = true;
    }
    p++;
  }

  if (end != nullptr) {
    *end = const_cast<char *>(p == digitsStart ? text : p);
  }
  if (overflow) {
    return ~0ULL;
  }
  return negative ? (0 - value) : value;
}

void StrCpy(CHAR16 *destination, const CHAR16 *source) {
  UINTN i = 0;
  do {
    destination[i] = source[i];
  } while (source[i++] != 0);
}

UINT64 StrLen(const CHAR16 *text) {
  UINT64 length = 0;
  while (text[length] != 0) {
    length++;
  }
  return length;
}

INT64 StrCmp(const CHAR16 *a, const CHAR16 *b) {
  while (*a != 0 && *a == *b) {
    a++;
    b++;
  }
  return static_cast<INT64>(static_cast<UINT16>(*a)) - static_cast<INT64>(static_cast<UINT16>(*b));
}

BOOLEAN CompareGuid(const EFI_GUID *a, const EFI_GUID *b) {
  const AliasedUint32 *x = reinterpret_cast<const AliasedUint32 *>(a);
  const AliasedUint32 *y = reinterpret_cast<const AliasedUint32 *>(b);
  return (x[0] == y[0] && x[1] == y[1] && x[2] == y[2] && x[3] == y[3]) ? TRUE : FALSE;
}

}  // namespace nimb
