#include "report.h"

namespace nimb::guest {

namespace {

ReportCounts gCounts;

void PrintString(const char *text) {
  if (text == nullptr) {
    text = "(null)";
  }
  while (*text != '\0') {
    ReportOutput(*text++);
  }
}

void PrintNumber(uint64_t value, uint32_t base, uint32_t width, char pad) {
  char digits[24];
  uint32_t count = 0;
  // 64-bit values are only printed in hexadecimal: a 32-bit kernel has no
  // 64-bit division without a runtime library.
  if (base == 16) {
    do {
      digits[count++] = "0123456789abcdef"[value & 15];
      value >>= 4;
    } while (value != 0);
  } else {
    uint32_t small = static_cast<uint32_t>(value);
    do {
      digits[count++] = static_cast<char>('0' + small % 10);
      small /= 10;
    } while (small != 0);
  }
  for (uint32_t i = count; i < width; i++) {
    ReportOutput(pad);
  }
  while (count > 0) {
    ReportOutput(digits[--count]);
  }
}

}  // namespace

void PrintV(const char *format, va_list arguments) {
  for (const char *p = format; *p != '\0'; p++) {
    if (*p != '%') {
      ReportOutput(*p);
      continue;
    }
    p++;
    char pad = ' ';
    if (*p == '0') {
      pad = '0';
      p++;
    }
    uint32_t width = 0;
    while (*p >= '0' && *p <= '9') {
      width = width * 10 + static_cast<uint32_t>(*p++ - '0');
    }
    bool wide = false;
    if (p[0] == 'l' && p[1] == 'l') {
      wide = true;
      p += 2;
    }
    switch (*p) {
      case 's':
        PrintString(va_arg(arguments, const char *));
        break;
      case 'c':
        ReportOutput(static_cast<char>(va_arg(arguments, int)));
        break;
      case 'd': {
        int value = va_arg(arguments, int);
        if (value < 0) {
          ReportOutput('-');
        }
        uint32_t magnitude = value < 0 ? 0u - static_cast<uint32_t>(value) : static_cast<uint32_t>(value);
        PrintNumber(magnitude, 10, width, pad);
        break;
      }
      case 'u':
        PrintNumber(va_arg(arguments, unsigned int), 10, width, pad);
        break;
      case 'x':
        PrintNumber(wide ? va_arg(arguments, unsigned long long) : va_arg(arguments, unsigned int), 16, width,
                    pad);
        break;
      case '%':
        ReportOutput('%');
        break;
      case '\0':
        return;
      default:
        ReportOutput('%');
        ReportOutput(*p);
        break;
    }
  }
}

void Print(const char *format, ...) {
  va_list arguments;
  va_start(arguments, format);
  PrintV(format, arguments);
  va_end(arguments);
}

void LineStart() {
  PrintString("kernel: ");
}

void LineEnd() {
  ReportOutput('\n');
}

void Line(const char *format, ...) {
  LineStart();
  va_list arguments;
  va_start(arguments, format);
  PrintV(format, arguments);
  va_end(arguments);
  LineEnd();
}

void PrintTextByte(uint8_t byte) {
  if (byte == '"' || byte == '\\') {
    ReportOutput('\\');
    ReportOutput(static_cast<char>(byte));
  } else if (byte < 0x20 || byte > 0x7E) {
    Print("\\x%02x", byte);
  } else {
    ReportOutput(static_cast<char>(byte));
  }
}

void PrintQuoted(const char *text, uint32_t length) {
  ReportOutput('"');
  for (uint32_t i = 0; i < length && text[i] != '\0'; i++) {
    PrintTextByte(static_cast<uint8_t>(text[i]));
  }
  ReportOutput('"');
}

bool Check(const char *name, bool ok, const char *format, ...) {
  gCounts.checks++;
  if (!ok) {
    gCounts.failed++;
  }
  LineStart();
  Print("check %s %s", name, ok ? "ok" : "FAIL");
  if (format[0] != '\0') {
    ReportOutput(' ');
    va_list arguments;
    va_start(arguments, format);
    PrintV(format, arguments);
    va_end(arguments);
  }
  LineEnd();
  return ok;
}

ReportCounts ReportCountsSoFar() {
  return gCounts;
}

void ReportReset() {
  gCounts = ReportCounts{};
}

bool ReportResult() {
  bool pass = gCounts.failed == 0 && gCounts.checks != 0;
  Line("result %s (%u checks, %u failed)", pass ? "pass" : "fail", gCounts.checks, gCounts.failed);
  return pass;
}

}  // namespace nimb::guest
