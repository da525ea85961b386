// The platform layer's configuration: \EFI\BOOT\platform.cfg on its own
// volume, UTF-8 text of `key=value` lines.
//
// Blanks and tabs around keys and values are dropped. A line whose first
// non-blank character is `#` is a comment, and empty lines are skipped. A
// value in double quotes keeps its blanks and may hold the escapes \\, \",
// \n, \r and \t. A key that comes twice takes the later value. Unknown keys
// are reported and ignored; a line without `=` or a value that its key
// refuses is an error.
//
// A new key is a field below, a function that checks and stores its value,
// and a row of the key table in config.cpp.
#pragma once

#include "efi/efi.h"

namespace nimb::platform {

struct PlatformConfig {
  // The loader's path on the platform's own volume.
  const char *loaderPath;
  // The loader's load options; null when the file gives none, in which case
  // the loader gets none at all (not an empty text).
  const char *options;
  // The console mode that the loader finds when it starts.
  EFI_CONSOLE_CONTROL_SCREEN_MODE consoleMode;
  // Seconds to wait between the report and the power-off.
  UINT32 holdSeconds;
};

constexpr const char *kDefaultLoaderPath = "\\EFI\\BOOT\\nimbboot.efi";
constexpr UINT32 kMaxHoldSeconds = 3600;

enum ConfigProblem : UINT32 {
  kConfigUnknownKey,  // reported, not an error
  kConfigNoEquals,
  kConfigBadValue,
};

struct ConfigIssue {
  ConfigProblem problem;
  UINT32 line;        // from 1
  const char *key;    // the whole line for kConfigNoEquals
  const char *value;  // null for kConfigNoEquals
};

typedef void (*ConfigReport)(const ConfigIssue &issue, void *context);

void ConfigSetDefaults(PlatformConfig *config);

// Parses `size` bytes of `text` into `config`, over the defaults or earlier
// values. The text is cut up in place: `text` must have room for one more
// byte behind `size`, and the strings that `config` gets point into it.
// Returns the number of errors; `report` hears of every issue.
UINT32 ConfigParse(char *text, UINTN size, PlatformConfig *config, ConfigReport report, void *context);

// UTF-8 to UCS-2 with a NUL unit behind. `*units` gets the number of units
// without the NUL. With a null `destination` only counts; otherwise
// `capacity` units (the NUL counted) must suffice. False for malformed text,
// for a character beyond U+FFFF and for too small a destination.
bool Utf8ToUcs2(const char *text, CHAR16 *destination, UINTN capacity, UINTN *units);

}  // namespace nimb::platform
