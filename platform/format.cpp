#include "format.h"

namespace nimb::platform {

namespace {

void FormatUnsigned(FormatOutput output, void *context, UINT64 value, UINT32 base) {
  char digits[24];
  UINTN count = 0;
  do {
    digits[count++] = "0123456789abcdef"[value % base];
    value /= base;
  } while (value != 0);
  while (count > 0) {
    output(digits[--count], context);
  }
}

struct BufferSink {
  char *buffer;
  UINTN size;
  UINTN length;
};

void BufferOutput(char character, void *context) {
  BufferSink *sink = static_cast<BufferSink *>(context);
  if (sink->length + 1 < sink->size) {
    sink->buffer[sink->length] = character;
  }
  sink->length++;
}

struct StatusNameEntry {
  EFI_STATUS status;
  const char *name;
};

constexpr StatusNameEntry kStatusNames[] = {
    {EFI_SUCCESS, "EFI_SUCCESS"},
    {EFI_LOAD_ERROR, "EFI_LOAD_ERROR"},
    {EFI_INVALID_PARAMETER, "EFI_INVALID_PARAMETER"},
    {EFI_UNSUPPORTED, "EFI_UNSUPPORTED"},
    {EFI_BAD_BUFFER_SIZE, "EFI_BAD_BUFFER_SIZE"},
    {EFI_BUFFER_TOO_SMALL, "EFI_BUFFER_TOO_SMALL"},
    {EFI_NOT_READY, "EFI_NOT_READY"},
    {EFI_DEVICE_ERROR, "EFI_DEVICE_ERROR"},
    {EFI_WRITE_PROTECTED, "EFI_WRITE_PROTECTED"},
    {EFI_OUT_OF_RESOURCES, "EFI_OUT_OF_RESOURCES"},
    {EFI_VOLUME_CORRUPTED, "EFI_VOLUME_CORRUPTED"},
    {EFI_VOLUME_FULL, "EFI_VOLUME_FULL"},
    {EFI_NO_MEDIA, "EFI_NO_MEDIA"},
    {EFI_MEDIA_CHANGED, "EFI_MEDIA_CHANGED"},
    {EFI_NOT_FOUND, "EFI_NOT_FOUND"},
    {EFI_ACCESS_DENIED, "EFI_ACCESS_DENIED"},
    {EFI_NO_RESPONSE, "EFI_NO_RESPONSE"},
    {EFI_NO_MAPPING, "EFI_NO_MAPPING"},
    {EFI_TIMEOUT, "EFI_TIMEOUT"},
    {EFI_NOT_STARTED, "EFI_NOT_STARTED"},
    {EFI_ALREADY_STARTED, "EFI_ALREADY_STARTED"},
    {EFI_ABORTED, "EFI_ABORTED"},
    {EFI_ICMP_ERROR, "EFI_ICMP_ERROR"},
    {EFI_TFTP_ERROR, "EFI_TFTP_ERROR"},
    {EFI_PROTOCOL_ERROR, "EFI_PROTOCOL_ERROR"},
    {EFI_INCOMPATIBLE_VERSION, "EFI_INCOMPATIBLE_VERSION"},
    {EFI_SECURITY_VIOLATION, "EFI_SECURITY_VIOLATION"},
    {EFI_CRC_ERROR, "EFI_CRC_ERROR"},
    {EFI_END_OF_MEDIA, "EFI_END_OF_MEDIA"},
    {EFI_END_OF_FILE, "EFI_END_OF_FILE"},
};

}  // namespace

void FormatText(FormatOutput output, void *context, const char *format, va_list arguments) {
  for (const char *p = format; *p != '\0'; p++) {
    if (*p != '%' || p[1] == '\0') {
      output(*p, context);
      continue;
    }
    p++;
    switch (*p) {
      case 's': {
        const char *text = va_arg(arguments, const char *);
        for (const char *t = text != nullptr ? text : "(null)"; *t != '\0'; t++) {
          output(*t, context);
        }
        break;
      }
      case 'u':
        FormatUnsigned(output, context, va_arg(arguments, UINT64), 10);
        break;
      case 'x':
        FormatUnsigned(output, context, va_arg(arguments, UINT64), 16);
        break;
      case 'c':
        output(static_cast<char>(va_arg(arguments, int)), context);
        break;
      case '%':
        output('%', context);
        break;
      default:
        output('%', context);
        output(*p, context);
        break;
    }
  }
}

UINTN FormatToBufferv(char *buffer, UINTN size, const char *format, va_list arguments) {
  BufferSink sink = {buffer, size, 0};
  FormatText(BufferOutput, &sink, format, arguments);
  if (size != 0) {
    buffer[sink.length < size ? sink.length : size - 1] = '\0';
  }
  return sink.length;
}

UINTN FormatToBuffer(char *buffer, UINTN size, const char *format, ...) {
  va_list arguments;
  va_start(arguments, format);
  const UINTN length = FormatToBufferv(buffer, size, format, arguments);
  va_end(arguments);
  return length;
}

const char *StatusName(EFI_STATUS status) {
  for (const StatusNameEntry &entry : kStatusNames) {
    if (entry.status == status) {
      return entry.name;
    }
  }
  return "unknown status";
}

}  // namespace nimb::platform
