#include "screen/console.h"

#include "boot/boot.h"

namespace nimb {

EFI_CONSOLE_CONTROL_PROTOCOL *gConsoleControl;
UINT32 gConsoleMode;
UINT32 gInitialConsoleMode;

// The one static buffer of the console: a character and its terminator.
static CHAR16 gConsoleOutputUnit[2];

static const char kDigits[] = "0123456789abcdef0123456789ABCDEF";

// Printed for a null string argument, so that a message never reads
// through null.
static const char kNullString[] = "<null string>";

// 22 digits: a 64-bit value in base 8.
constexpr UINT32 kMaxDigits = 22;

void FormatNumber(UINT64 value, UINT32 base, UINT32 flags, UINT32 width, PutCharFunction putChar,
                  void *context) {
  bool negative = false;
  if (base == 10 && (value & 0x80000000ULL) != 0) {
    negative = true;
    value = static_cast<UINT32>(0U - static_cast<UINT32>(value));
  }
  if (base < 2 || base > 16) {
    base = 16;
  }
  const char *digits = (flags & kFormatUpperCase) ? kDigits + 16 : kDigits;
  char buffer[kMaxDigits];
  UINT32 count = 0;
  do {
    buffer[count++] = digits[value % base];
    value /= base;
  } while (value != 0 && count < kMaxDigits);

  UINT32 written = count;
  if (negative) {
    putChar('-', context);
    written++;
  }
  for (; written < width; written++) {
    putChar((flags & kFormatZeroPad) ? '0' : ' ', context);
  }
  while (count > 0) {
    putChar(buffer[--count], context);
  }
}

// Writes an 8-bit string, then blanks up to `width` characters.
static void FormatString(const char *text, UINT32 width, PutCharFunction putChar, void *context) {
  if (text == nullptr) {
    text = kNullString;
  }
  UINT32 written = 0;
  for (; *text != '\0'; text++, written++) {
    putChar(static_cast<INT8>(*text), context);
  }
  for (; written < width; written++) {
    putChar(' ', context);
  }
}

// Writes the low byte of each UCS-2 unit, up to the first unit whose low byte
// is zero, then blanks up to `width` characters.
static void FormatWideString(const CHAR16 *text, UINT32 width, PutCharFunction putChar, void *context) {
  if (text == nullptr) {
    FormatString(nullptr, width, putChar, context);
    return;
  }
  UINT32 written = 0;
  for (; (*text & 0xFF) != 0; text++, written++) {
    putChar(static_cast<INT8>(*text & 0xFF), context);
  }
  for (; written < width; written++) {
    putChar(' ', context);
  }
}

void FormatEngine(const char *format, PutCharFunction putChar, void *context, va_list arguments) {
  va_list args;
  va_copy(args, arguments);
  while (*format != '\0') {
    char c = *format++;
    if (c != '%') {
      putChar(static_cast<INT8>(c), context);
      continue;
    }
    UINT32 flags = 0;
    UINT32 width = 0;
    UINT32 size = 0;
    bool done = false;
    while (!done) {
      c = *format;
      if (c == '\0') {
        va_end(args);
        return;
      }
      format++;
      done = true;
      UINT32 base = 0;
      switch (c) {
        case ' ':
          flags |= kFormatBlank;
          done = false;
          break;
        case '0':
          if (width == 0) {
            flags |= kFormatZeroPad;
          } else {
            width *= 10;
          }
          done = false;
          break;
        case '1':
        case '2':
        case '3':
        case '4':
        case '5':
        case '6':
        case '7':
        case '8':
        case '9':
          width = width * 10 + static_cast<UINT32>(c - '0');
          done = false;
          break;
        case 'l':
          size = 1;
          done = false;
          break;
        case 'q':
          size = 2;
          done = false;
          break;
        case 'd':
          base = 10;
          break;
        case 'o':
        case 'O':
          base = 8;
          break;
        case 'x':
          base = 16;
          break;
        case 'X':
          base = 16;
          flags |= kFormatUpperCase;
          break;
        case 'p':
        case 'P':
          base = 16;
          size = 2;
          if (c == 'P') {
            flags |= kFormatUpperCase;
          }
          putChar('0', context);
          putChar('x', context);
          break;
        case 'c': {
          UINT64 slot = va_arg(args, UINT64);
          putChar(static_cast<INT32>(static_cast<UINT32>(slot)), context);
          break;
        }
        case 's':
          FormatString(va_arg(args, const char *), width, putChar, context);
          break;
        case 'S':
          FormatWideString(va_arg(args, const CHAR16 *), width, putChar, context);
          break;
        default:
          // Unknown directive: swallowed whole, no argument taken.
          break;
      }
      if (base != 0) {
        UINT64 slot = va_arg(args, UINT64);
        UINT64 value = size == 0 ? (slot & 0xFFFFFFFFULL) : slot;
        FormatNumber(value, base, flags, width, putChar, context);
      }
    }
  }
  va_end(args);
}

static void BufferPutChar(INT32 character, void *context) {
  char **position = static_cast<char **>(context);
  **position = static_cast<char>(character & 0xFF);
  (*position)++;
}

int sprintf(char *buffer, const char *format, ...) {
  char *position = buffer;
  va_list arguments;
  va_start(arguments, format);
  FormatEngine(format, BufferPutChar, &position, arguments);
  va_end(arguments);
  *position = '\0';
  return 0;
}

static EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *ConsoleDevice() {
  if (gST == nullptr) {
    return nullptr;
  }
  if (gST->ConOut != nullptr) {
    return gST->ConOut;
  }
  return gST->StdErr;
}

static void OutputUnit(UINT16 unit) {
  EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *device = ConsoleDevice();
  if (device == nullptr) {
    return;
  }
  gConsoleOutputUnit[0] = unit;
  gConsoleOutputUnit[1] = 0;
  device->OutputString(device, gConsoleOutputUnit);
}

void ConsolePutChar(INT32 character, void *) {
  if (character == '\t') {
    for (int i = 0; i < 8; i++) {
      OutputUnit(' ');
    }
  } else if (character == '\n') {
    OutputUnit('\r');
    OutputUnit('\n');
  } else {
    OutputUnit(static_cast<UINT16>(character));
  }
}

int printf(const char *format, ...) {
  va_list arguments;
  va_start(arguments, format);
  FormatEngine(format, ConsolePutChar, nullptr, arguments);
  va_end(arguments);
  return 0;
}

// Messages about bad input; they go where every other message goes.
int ErrorPrintf(const char *format, ...) {
  va_list arguments;
  va_start(arguments, format);
  FormatEngine(format, ConsolePutChar, nullptr, arguments);
  va_end(arguments);
  return 0;
}

void Fatal(const char *format, ...) {
  va_list arguments;
  va_start(arguments, format);
  FormatEngine(format, ConsolePutChar, nullptr, arguments);
  va_end(arguments);
  ExitBoot(EFI_ABORTED);
}

EFI_STATUS InitConsole() {
  EFI_CONSOLE_CONTROL_PROTOCOL *control = nullptr;
  EFI_STATUS status =
      gBS->LocateProtocol(&gEfiConsoleControlProtocolGuid, nullptr, reinterpret_cast<void **>(&control));
  if (EFI_ERROR(status)) {
    return status;
  }
  if (control == nullptr) {
    return EFI_NOT_FOUND;
  }
  gConsoleControl = control;
  EFI_CONSOLE_CONTROL_SCREEN_MODE mode = EfiConsoleControlScreenText;
  status = control->GetMode(control, &mode, nullptr, nullptr);
  if (EFI_ERROR(status)) {
    return status;
  }
  gConsoleMode = mode;
  gInitialConsoleMode = mode;
  return EFI_SUCCESS;
}

// Puts the console in `mode` (the protocol's value) unless it is there.
static EFI_STATUS ChangeConsoleMode(UINT32 mode) {
  if (mode == gConsoleMode) {
    return EFI_SUCCESS;
  }
  if (gConsoleControl == nullptr) {
    return EFI_NOT_READY;
  }
  EFI_STATUS status =
      gConsoleControl->SetMode(gConsoleControl, static_cast<EFI_CONSOLE_CONTROL_SCREEN_MODE>(mode));
  if (EFI_ERROR(status)) {
    return status;
  }
  gConsoleMode = mode;
  return EFI_SUCCESS;
}

EFI_STATUS SetConsoleMode(UINT32 mode) {
  if (mode == kConsoleGraphics) {
    return ChangeConsoleMode(EfiConsoleControlScreenGraphics);
  }
  if (mode == kConsoleText) {
    return ChangeConsoleMode(EfiConsoleControlScreenText);
  }
  return EFI_INVALID_PARAMETER;
}

EFI_STATUS RestoreConsoleMode() {
  return ChangeConsoleMode(gInitialConsoleMode);
}

}  // namespace nimb
