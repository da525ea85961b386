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

// The keys of the words of an option string that is being built, so that
// the duplicate test of AppendOption takes the same time however long the
// string grows: an open-addressed table in tracked pool of the offsets of
// the words (plus one; 0 is a free slot).
struct OptionKeyIndex {
  char *base;
  UINT32 *slots;  // null when there is no index: AppendOption searches then
  UINT64 mask;    // slot count - 1
};
// Indexes the words of `base`, a buffer of `bytes`, with room for `words`
// words in all. Without memory for it (or for a buffer too big for 32-bit
// offsets) there is no index, and the appends below behave the same, only
// slower.
void OptionKeyIndexInit(OptionKeyIndex *index, char *base, UINT64 bytes, UINT64 words);
void OptionKeyIndexFree(OptionKeyIndex *index);
// AppendOption(index->base, end, ...), with the index kept in step.
char *AppendIndexedOption(OptionKeyIndex *index, char *end, const char *word, UINT64 keyLength,
                          UINT64 wordLength);
// The number of words of `text`, as NextOption splits it.
UINT64 CountOptionWords(const char *text);

}  // namespace nimb
