// Wide formatting of path names. Only the directives the loader's own path
// formats use are known; every argument takes one 64-bit slot.
#include "support/sprint.h"

#include <stdarg.h>

namespace nimb {

namespace {

const CHAR16 kNullString[] = u"<null string>";
const char kHexDigits[] = "0123456789ABCDEF";

// The output buffer: `limit` units of text, then the terminator.
struct WideSink {
  CHAR16 *buffer;
  UINTN limit;
  UINTN count;

  bool Full() const { return count >= limit; }
  void Put(CHAR16 unit) {
    if (!Full()) {
      buffer[count++] = unit;
    }
  }
  void PutWide(const CHAR16 *text) {
    for (; *text != 0 && !Full(); text++) {
      Put(*text);
    }
  }
  // Bytes widened with a zero high byte.
  void PutNarrow(const char *text) {
    for (; *text != '\0' && !Full(); text++) {
      Put(static_cast<CHAR16>(static_cast<UINT8>(*text)));
    }
  }
};

}  // namespace

UINTN SPrint(CHAR16 *buffer, UINTN size, const CHAR16 *format, ...) {
  if (size < 2) {
    return 0;
  }
  WideSink out{buffer, size / 2 - 1, 0};
  va_list arguments;
  va_start(arguments, format);
  for (const CHAR16 *f = format; *f != 0 && !out.Full(); f++) {
    if (*f != u'%') {
      out.Put(*f);
      continue;
    }
    const CHAR16 *directive = f;
    // A width (the loader writes only "%08x") gives the exact number of hex
    // digits: the low ones, so a larger number is cut. None means 8.
    UINTN width = 0;
    while (f[1] >= u'0' && f[1] <= u'9') {
      width = width * 10 + (f[1] - u'0');
      f++;
    }
    switch (f[1]) {
      case u'S': {
        const CHAR16 *text = va_arg(arguments, const CHAR16 *);
        out.PutWide(text != nullptr ? text : kNullString);
        f++;
        break;
      }
      case u'a': {
        const char *text = va_arg(arguments, const char *);
        if (text == nullptr) {
          out.PutWide(kNullString);
        } else {
          out.PutNarrow(text);
        }
        f++;
        break;
      }
      case u'x':
      case u'X': {
        const UINT64 value = va_arg(arguments, UINT64);
        if (width == 0) {
          width = 8;
        } else if (width > 16) {
          width = 16;
        }
        for (UINTN digit = width; digit-- > 0;) {
          out.Put(static_cast<CHAR16>(kHexDigits[(value >> (4 * digit)) & 0xF]));
        }
        f++;
        break;
      }
      case u'%':
        out.Put(u'%');
        f++;
        break;
      default:
        // Not a directive of ours: written as it stands, so that a mistake
        // shows in the name instead of taking an argument.
        for (const CHAR16 *t = directive; t <= f; t++) {
          out.Put(*t);
        }
        break;
    }
  }
  va_end(arguments);
  buffer[out.count] = 0;
  return out.count + 1;
}

}  // namespace nimb
