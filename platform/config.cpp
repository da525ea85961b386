#include "config.h"

#include "support/strings.h"

namespace nimb::platform {

namespace {

// --- values ------------------------------------------------------------------

bool ApplyLoader(PlatformConfig *config, const char *value) {
  if (*value == '\0' || !Utf8ToUcs2(value, nullptr, 0, nullptr)) {
    return false;
  }
  config->loaderPath = value;
  return true;
}

bool ApplyOptions(PlatformConfig *config, const char *value) {
  if (!Utf8ToUcs2(value, nullptr, 0, nullptr)) {
    return false;
  }
  config->options = value;
  return true;
}

bool ApplyConsole(PlatformConfig *config, const char *value) {
  if (strcmp(value, "text") == 0) {
    config->consoleMode = EfiConsoleControlScreenText;
  } else if (strcmp(value, "graphics") == 0) {
    config->consoleMode = EfiConsoleControlScreenGraphics;
  } else {
    return false;
  }
  return true;
}

// Decimal digits only.
bool ParseDecimal(const char *value, UINT64 limit, UINT64 *number) {
  if (*value < '0' || *value > '9') {
    return false;
  }
  char *end = nullptr;
  *number = strtoul(value, &end, 10);
  return *end == '\0' && *number <= limit;
}

bool ApplyHold(PlatformConfig *config, const char *value) {
  UINT64 seconds = 0;
  if (!ParseDecimal(value, kMaxHoldSeconds, &seconds)) {
    return false;
  }
  config->holdSeconds = static_cast<UINT32>(seconds);
  return true;
}

struct ConfigKey {
  const char *name;
  bool (*apply)(PlatformConfig *config, const char *value);
};

constexpr ConfigKey kConfigKeys[] = {
    {"loader", ApplyLoader},
    {"options", ApplyOptions},
    {"console", ApplyConsole},
    {"hold", ApplyHold},
};

// --- lines ---------------------------------------------------------------------

bool IsBlank(char c) {
  return c == ' ' || c == '\t';
}

// Drops blanks at both ends of [start, end) and ends the text with a NUL.
char *Trim(char *start, char *end) {
  while (start < end && IsBlank(*start)) {
    start++;
  }
  while (end > start && (IsBlank(end[-1]) || end[-1] == '\r')) {
    end--;
  }
  *end = '\0';
  return start;
}

// The character that a backslash escape stands for; NUL for none.
char UnescapeCharacter(char c) {
  switch (c) {
    case '\\':
    case '"':
      return c;
    case 'n':
      return '\n';
    case 'r':
      return '\r';
    case 't':
      return '\t';
    default:
      return '\0';
  }
}

// Removes the quotes of a quoted value and resolves its escapes in place,
// once the whole value has been checked, so that a refused value is reported
// as it was written. An unquoted value stands as it is.
bool Unquote(char *value) {
  if (*value != '"') {
    return true;
  }
  const UINT32 length = strlen(value);
  if (length < 2 || value[length - 1] != '"') {
    return false;
  }
  for (UINT32 i = 1; i < length - 1; i++) {
    if (value[i] == '"') {
      return false;
    }
    if (value[i] == '\\') {
      i++;
      if (i == length - 1 || UnescapeCharacter(value[i]) == '\0') {
        return false;
      }
    }
  }
  char *out = value;
  for (UINT32 i = 1; i < length - 1; i++) {
    *out++ = value[i] == '\\' ? UnescapeCharacter(value[++i]) : value[i];
  }
  *out = '\0';
  return true;
}

UINT32 ParseLine(char *start, char *end, UINT32 line, PlatformConfig *config, ConfigReport report,
                 void *context) {
  char *text = Trim(start, end);
  if (*text == '\0' || *text == '#') {
    return 0;
  }
  char *equals = text;
  while (*equals != '\0' && *equals != '=') {
    equals++;
  }
  if (*equals == '\0') {
    report({kConfigNoEquals, line, text, nullptr}, context);
    return 1;
  }
  char *value = Trim(equals + 1, equals + 1 + strlen(equals + 1));
  char *key = Trim(text, equals);
  for (const ConfigKey &entry : kConfigKeys) {
    if (strcmp(key, entry.name) != 0) {
      continue;
    }
    if (Unquote(value) && entry.apply(config, value)) {
      return 0;
    }
    report({kConfigBadValue, line, key, value}, context);
    return 1;
  }
  report({kConfigUnknownKey, line, key, value}, context);
  return 0;
}

}  // namespace

void ConfigSetDefaults(PlatformConfig *config) {
  config->loaderPath = kDefaultLoaderPath;
  config->options = nullptr;
  config->consoleMode = EfiConsoleControlScreenGraphics;
  config->holdSeconds = 0;
}

UINT32 ConfigParse(char *text, UINTN size, PlatformConfig *config, ConfigReport report, void *context) {
  UINT32 errors = 0;
  UINT32 line = 1;
  char *start = text;
  for (UINTN i = 0; i <= size; i++) {
    if (i == size || text[i] == '\n' || text[i] == '\0') {
      errors += ParseLine(start, text + i, line, config, report, context);
      start = text + i + 1;
      line++;
    }
  }
  return errors;
}

bool Utf8ToUcs2(const char *text, CHAR16 *destination, UINTN capacity, UINTN *units) {
  const UINT8 *p = reinterpret_cast<const UINT8 *>(text);
  UINTN count = 0;
  while (*p != 0) {
    UINT32 code = *p++;
    UINT32 continuations = 0;
    UINT32 minimum = 0;
    if (code >= 0xE0 && code < 0xF0) {
      code &= 0x0F;
      continuations = 2;
      minimum = 0x800;
    } else if (code >= 0xC0 && code < 0xE0) {
      code &= 0x1F;
      continuations = 1;
      minimum = 0x80;
    } else if (code >= 0x80) {
      // A stray continuation byte, or a character beyond U+FFFF.
      return false;
    }
    for (UINT32 i = 0; i < continuations; i++, p++) {
      if ((*p & 0xC0) != 0x80) {
        return false;
      }
      code = (code << 6) | (*p & 0x3F);
    }
    if (code < minimum || (code >= 0xD800 && code <= 0xDFFF)) {
      return false;
    }
    if (destination != nullptr) {
      if (count + 1 >= capacity) {
        return false;
      }
      destination[count] = static_cast<CHAR16>(code);
    }
    count++;
  }
  if (destination != nullptr) {
    if (count >= capacity) {
      return false;
    }
    destination[count] = 0;
  }
  if (units != nullptr) {
    *units = count;
  }
  return true;
}

}  // namespace nimb::platform
