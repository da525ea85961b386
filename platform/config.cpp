#include "config.h"

#include "efi/vendor.h"
#include "support/strings.h"

namespace nimb::platform {

namespace {

// --- values ------------------------------------------------------------------

// Each key's function gets the name behind the key's prefix (empty for a key
// without one) and the value, which it may rewrite in place once it has found
// it good: a refused value is reported as it was written.

bool ApplyLoader(PlatformConfig *config, const char *, char *value) {
  if (*value == '\0' || !Utf8ToUcs2(value, nullptr, 0, nullptr)) {
    return false;
  }
  config->loaderPath = value;
  return true;
}

bool ApplyTimedRead(PlatformConfig *config, const char *, char *value) {
  if (*value == '\0' || !Utf8ToUcs2(value, nullptr, 0, nullptr)) {
    return false;
  }
  config->timedReadPath = value;
  return true;
}

bool ApplyTimeText(PlatformConfig *config, const char *, char *value) {
  if (strcmp(value, "0") != 0 && strcmp(value, "1") != 0) {
    return false;
  }
  config->timeText = value[0] == '1';
  return true;
}

bool ApplyOptions(PlatformConfig *config, const char *, char *value) {
  if (!Utf8ToUcs2(value, nullptr, 0, nullptr)) {
    return false;
  }
  config->options = value;
  return true;
}

bool ApplyConsole(PlatformConfig *config, const char *, char *value) {
  if (strcmp(value, "text") == 0) {
    config->consoleMode = EfiConsoleControlScreenText;
  } else if (strcmp(value, "graphics") == 0) {
    config->consoleMode = EfiConsoleControlScreenGraphics;
  } else if (strcmp(value, "none") == 0) {
    config->consoleMode = kConsoleNone;
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

bool ApplyHold(PlatformConfig *config, const char *, char *value) {
  UINT64 seconds = 0;
  if (!ParseDecimal(value, kMaxHoldSeconds, &seconds)) {
    return false;
  }
  config->holdSeconds = static_cast<UINT32>(seconds);
  return true;
}

// Held keys.

struct NamedModifier {
  const char *name;
  UINT16 bit;
};

// Bits of the modifier mask, as a USB HID keyboard report has them.
constexpr NamedModifier kModifiers[] = {
    {"ctrl", 0x01},
    {"lctrl", 0x01},
    {"shift", kKeyModifierLeftShift},
    {"lshift", kKeyModifierLeftShift},
    {"alt", 0x04},
    {"lalt", 0x04},
    {"gui", kKeyModifierLeftGui},
    {"lgui", kKeyModifierLeftGui},
    {"rctrl", 0x10},
    {"rshift", kKeyModifierRightShift},
    {"ralt", 0x40},
    {"rgui", kKeyModifierRightGui},
};

constexpr UINT16 kKeyboardPage = 0x7000;
constexpr UINT16 kUsageA = 0x04;
constexpr UINT16 kUsage1 = 0x1E;  // then 2 to 9, and 0 at 0x27
constexpr UINT16 kUsage0 = 0x27;

int HexDigit(char c) {
  if (c >= '0' && c <= '9') {
    return c - '0';
  }
  if (c >= 'a' && c <= 'f') {
    return c - 'a' + 10;
  }
  if (c >= 'A' && c <= 'F') {
    return c - 'A' + 10;
  }
  return -1;
}

// The key value of a key's name; 0 for none.
UINT16 KeyValue(const char *name) {
  if (name[0] >= 'a' && name[0] <= 'z' && name[1] == '\0') {
    return static_cast<UINT16>(kKeyboardPage + kUsageA + (name[0] - 'a'));
  }
  if (name[0] >= '0' && name[0] <= '9' && name[1] == '\0') {
    return static_cast<UINT16>(kKeyboardPage + (name[0] == '0' ? kUsage0 : kUsage1 + (name[0] - '1')));
  }
  if (name[0] != '0' || name[1] != 'x' || name[2] == '\0') {
    return 0;
  }
  UINT32 usage = 0;
  for (const char *p = name + 2; *p != '\0'; p++) {
    const int digit = HexDigit(*p);
    if (digit < 0 || usage > 0xF) {
      return 0;
    }
    usage = usage * 16 + static_cast<UINT32>(digit);
  }
  return usage == 0 ? 0 : static_cast<UINT16>(kKeyboardPage + usage);
}

// Adds one name of a `keys` value to `held`.
bool AddHeldKey(HeldKeys *held, const char *name) {
  for (const NamedModifier &modifier : kModifiers) {
    if (strcmp(name, modifier.name) == 0) {
      held->modifiers = static_cast<UINT16>(held->modifiers | modifier.bit);
      return true;
    }
  }
  const UINT16 key = KeyValue(name);
  if (key == 0 || held->count == kMaxHeldKeys) {
    return false;
  }
  for (UINT32 i = 0; i < held->count; i++) {
    if (held->keys[i] == key) {
      return false;
    }
  }
  held->keys[held->count++] = key;
  return true;
}

// The longest name of a key or modifier, with its NUL.
constexpr UINT32 kKeyNameCapacity = 8;

bool ApplyKeys(PlatformConfig *config, const char *, char *value) {
  HeldKeys held = {};
  const char *p = value;
  bool more = *p != '\0';
  while (more) {
    char name[kKeyNameCapacity];
    UINT32 length = 0;
    for (; *p != '\0' && *p != '+'; p++) {
      if (length + 1 == kKeyNameCapacity) {
        return false;
      }
      name[length++] = *p;
    }
    name[length] = '\0';
    if (!AddHeldKey(&held, name)) {
      return false;
    }
    more = *p++ == '+';
  }
  config->keys = held;
  config->keysGiven = true;
  return true;
}

// A flag: 0 or 1.
bool ApplyFlag(bool *flag, const char *value) {
  UINT64 number = 0;
  if (!ParseDecimal(value, 1, &number) || value[1] != '\0') {
    return false;
  }
  *flag = number != 0;
  return true;
}

bool ApplyKeysIgnored(PlatformConfig *config, const char *, char *value) {
  return ApplyFlag(&config->keysIgnored, value);
}

bool ApplyFirmwareProtocols(PlatformConfig *config, const char *, char *value) {
  if (strcmp(value, "keep") != 0 && strcmp(value, "replace") != 0) {
    return false;
  }
  config->replaceFirmwareProtocols = value[0] == 'r';
  return true;
}

bool ApplyDebugExit(PlatformConfig *config, const char *, char *value) {
  if (strcmp(value, "auto") == 0) {
    config->debugExit = kDebugExitAuto;
    return true;
  }
  bool on = false;
  if (!ApplyFlag(&on, value)) {
    return false;
  }
  config->debugExit = on ? kDebugExitOn : kDebugExitOff;
  return true;
}

bool ApplyWaitKey(PlatformConfig *config, const char *, char *value) {
  return ApplyFlag(&config->waitKey, value);
}

bool ApplyTimePxe(PlatformConfig *config, const char *, char *value) {
  return ApplyFlag(&config->timePxeDownload, value);
}

// Variables and records.

// Pairs of hexadecimal digits, with blanks allowed between pairs: checks
// `value` and counts its bytes.
bool HexSize(const char *value, UINT32 *size) {
  UINT32 count = 0;
  for (const char *p = value; *p != '\0'; p++) {
    if (*p == ' ' || *p == '\t') {
      continue;
    }
    if (HexDigit(p[0]) < 0 || HexDigit(p[1]) < 0) {
      return false;
    }
    p++;
    count++;
  }
  *size = count;
  return true;
}

// Decodes a value that HexSize has passed into bytes, in place.
void DecodeHex(char *value) {
  UINT8 *out = reinterpret_cast<UINT8 *>(value);
  for (const char *p = value; *p != '\0'; p++) {
    if (*p != ' ' && *p != '\t') {
      *out++ = static_cast<UINT8>(HexDigit(p[0]) << 4 | HexDigit(p[1]));
      p++;
    }
  }
}

// Stores a value under `name`, in the place of an earlier value of the name.
// Nothing is changed, the value included, unless the whole line is good.
bool AddEntry(ConfigEntryList *list, const char *name, char *value, bool hex, bool allowEmpty,
              ConfigVariableLife life = kVariableForGood) {
  if (*name == '\0' || !Utf8ToUcs2(name, nullptr, 0, nullptr)) {
    return false;
  }
  UINT32 size = strlen(value);
  if (hex ? !HexSize(value, &size) : !Utf8ToUcs2(value, nullptr, 0, nullptr)) {
    return false;
  }
  if (size == 0 && !allowEmpty) {
    return false;
  }
  UINT32 index = 0;
  while (index < list->count && strcmp(list->entries[index].name, name) != 0) {
    index++;
  }
  if (index == kMaxConfigEntries) {
    return false;
  }
  if (hex) {
    DecodeHex(value);
  }
  if (index == list->count) {
    list->count++;
  }
  list->entries[index] = {name, reinterpret_cast<const UINT8 *>(value), size, !hex, life};
  return true;
}

// An NVRAM variable cannot be empty; a record's value can. A deleted
// variable has no value.
bool ApplyNvramText(PlatformConfig *config, const char *name, char *value) {
  return AddEntry(&config->nvram, name, value, false, false);
}

bool ApplyNvramHex(PlatformConfig *config, const char *name, char *value) {
  return AddEntry(&config->nvram, name, value, true, false);
}

bool ApplyNvramVolatileText(PlatformConfig *config, const char *name, char *value) {
  return AddEntry(&config->nvram, name, value, false, false, kVariableThisBoot);
}

bool ApplyNvramVolatileHex(PlatformConfig *config, const char *name, char *value) {
  return AddEntry(&config->nvram, name, value, true, false, kVariableThisBoot);
}

bool ApplyNvramDelete(PlatformConfig *config, const char *name, char *value) {
  return *value == '\0' && AddEntry(&config->nvram, name, value, false, true, kVariableDeleted);
}

bool ApplyDataHubText(PlatformConfig *config, const char *name, char *value) {
  return AddEntry(&config->dataHub, name, value, false, true);
}

bool ApplyDataHubHex(PlatformConfig *config, const char *name, char *value) {
  return AddEntry(&config->dataHub, name, value, true, true);
}

// A blob, an answer: any number of bytes, none included.
bool ApplyBytes(ConfigBytes *bytes, char *value) {
  UINT32 size = 0;
  if (!HexSize(value, &size)) {
    return false;
  }
  DecodeHex(value);
  *bytes = {reinterpret_cast<const UINT8 *>(value), size};
  return true;
}

bool ApplyDeviceProperties(PlatformConfig *config, const char *, char *value) {
  return ApplyBytes(&config->deviceProperties, value);
}

bool ApplyDhcpResponse(PlatformConfig *config, const char *, char *value) {
  return ApplyBytes(&config->dhcpResponse, value);
}

bool ApplyBsdpResponse(PlatformConfig *config, const char *, char *value) {
  return ApplyBytes(&config->bsdpResponse, value);
}

bool ApplyTimedExtents(PlatformConfig *config, const char *, char *value) {
  return ApplyBytes(&config->timedExtents, value);
}

// A key whose name ends in '.' is a prefix: it takes every key that starts
// with it, and its function gets the rest of the key as the name.
struct ConfigKey {
  const char *name;
  bool (*apply)(PlatformConfig *config, const char *name, char *value);
};

constexpr ConfigKey kConfigKeys[] = {
    {"loader", ApplyLoader},
    {"options", ApplyOptions},
    {"console", ApplyConsole},
    {"hold", ApplyHold},
    {"debug-exit", ApplyDebugExit},
    {"wait-key", ApplyWaitKey},
    {"net.time-pxe", ApplyTimePxe},
    {"keys", ApplyKeys},
    {"keys-ignored", ApplyKeysIgnored},
    {"firmware-protocols", ApplyFirmwareProtocols},
    {"nvram.", ApplyNvramText},
    {"nvram-hex.", ApplyNvramHex},
    {"nvram-volatile.", ApplyNvramVolatileText},
    {"nvram-volatile-hex.", ApplyNvramVolatileHex},
    {"nvram-delete.", ApplyNvramDelete},
    {"datahub.", ApplyDataHubText},
    {"datahub-hex.", ApplyDataHubHex},
    {"device-properties-hex", ApplyDeviceProperties},
    {"netboot.dhcp-hex", ApplyDhcpResponse},
    {"netboot.bsdp-hex", ApplyBsdpResponse},
    {"time-read", ApplyTimedRead},
    {"time-text", ApplyTimeText},
    {"time-read-extents-hex", ApplyTimedExtents},
};

// The name that `key` gives to the function of `entry`, or null when the
// key isn't the entry's.
const char *MatchKey(const ConfigKey &entry, const char *key) {
  const UINT32 length = strlen(entry.name);
  if (entry.name[length - 1] != '.') {
    return strcmp(key, entry.name) == 0 ? "" : nullptr;
  }
  return strncmp(key, entry.name, static_cast<INT32>(length)) == 0 ? key + length : nullptr;
}

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
    const char *name = MatchKey(entry, key);
    if (name == nullptr) {
      continue;
    }
    if (Unquote(value) && entry.apply(config, name, value)) {
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
  config->debugExit = kDebugExitAuto;
  config->waitKey = false;
  config->timePxeDownload = false;
  config->keys = {};
  config->keysGiven = false;
  config->keysIgnored = false;
  config->replaceFirmwareProtocols = false;
  config->nvram.count = 0;
  config->dataHub.count = 0;
  config->deviceProperties = {};
  config->dhcpResponse = {};
  config->bsdpResponse = {};
  config->timedReadPath = nullptr;
  config->timeText = false;
  config->timedExtents = {};
}

UINT32 ConfigParse(char *text, UINTN size, PlatformConfig *config, ConfigReport report, void *context) {
  // Editors that write a byte-order mark put it before the first key.
  constexpr char kByteOrderMark[] = "\xEF\xBB\xBF";
  if (size >= 3 && memcmp(text, kByteOrderMark, 3) == 0) {
    text += 3;
    size -= 3;
  }
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

void ConfigEcho(const char *text, char *echo, UINTN capacity) {
  static const char kDigits[] = "0123456789abcdef";
  UINTN length = 0;
  for (const UINT8 *p = reinterpret_cast<const UINT8 *>(text); *p != 0; p++) {
    length += *p >= 0x20 && *p < 0x7F ? 1 : 4;
  }
  // Room for the mark when the whole does not fit.
  const UINTN room = length < capacity ? capacity - 1 : capacity - 4;
  UINTN at = 0;
  for (const UINT8 *p = reinterpret_cast<const UINT8 *>(text); *p != 0; p++) {
    const bool plain = *p >= 0x20 && *p < 0x7F;
    if (at + (plain ? 1 : 4) > room) {
      break;
    }
    if (plain) {
      echo[at++] = static_cast<char>(*p);
    } else {
      echo[at++] = '\\';
      echo[at++] = 'x';
      echo[at++] = kDigits[*p >> 4];
      echo[at++] = kDigits[*p & 15];
    }
  }
  if (length >= capacity) {
    echo[at++] = '.';
    echo[at++] = '.';
    echo[at++] = '.';
  }
  echo[at] = '\0';
}

EFI_STATUS ConfigBytesAnswer(const ConfigBytes &answer, void *buffer, UINTN *size) {
  if (size == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  if (answer.bytes == nullptr) {
    return EFI_NOT_FOUND;
  }
  if (*size < answer.size) {
    *size = answer.size;
    return EFI_BUFFER_TOO_SMALL;
  }
  if (buffer == nullptr && answer.size != 0) {
    return EFI_INVALID_PARAMETER;
  }
  memcpy(buffer, answer.bytes, answer.size);
  *size = answer.size;
  return EFI_SUCCESS;
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
