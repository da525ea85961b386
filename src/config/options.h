// Reading and extending option strings: words set apart by blanks, flags
// such as `-v` and pairs such as `rd=x`. Two readers read the same text
// differently and are kept apart on purpose: GetOptionValue reads key and
// value pairs and knows quotes; NextOption and AppendOption split at blanks
// only and do not.
#pragma once

#include "efi/efi.h"

namespace nimb {

const char *ScanOptionWord(const char *text, const char **start, UINT64 *length);
EFI_STATUS GetOptionValue(const char *text, const char *key, const char **value, UINT64 *length);
EFI_STATUS GetOptionOrConfigValue(const char *text, const char *key, const char **value, UINT64 *length);
const char *GetConfigValue(const char *key);
const char *NextOption(const char *text, const char **word, UINT64 *keyLength, UINT64 *wordLength);
char *AppendOption(char *base, char *end, const char *word, UINT64 keyLength, UINT64 wordLength);

}  // namespace nimb
