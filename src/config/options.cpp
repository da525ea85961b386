#include "config/options.h"

#include "config/boot_options.h"
#include "config/plist.h"
#include "memory/tracking.h"
#include "support/strings.h"

namespace nimb {

// Space, tab, carriage return and line feed; nothing else is a blank.
static BOOLEAN IsBlank(char c) {
  return c == ' ' || c == '\t' || c == '\r' || c == '\n';
}

static const char *SkipBlanks(const char *text) {
  while (IsBlank(*text)) {
    text++;
  }
  return text;
}

// Case-folded comparison of `length` bytes; strncasecmp counts in 32 bits,
// so a longer key is compared a piece at a time.
static BOOLEAN KeyEquals(const char *word, const char *key, UINT64 length) {
  constexpr UINT64 kPiece = 0x40000000;
  while (length > 0) {
    const UINT64 piece = length < kPiece ? length : kPiece;
    if (strncasecmp(word, key, static_cast<INT32>(piece)) != 0) {
      return FALSE;
    }
    word += piece;
    key += piece;
    length -= piece;
  }
  return TRUE;
}

const char *ScanOptionWord(const char *text, const char **start, UINT64 *length) {
  if (*text == '"') {
    const char *p = text + 1;
    while (*p != '\0' && *p != '"') {
      p++;
    }
    *start = text + 1;
    *length = static_cast<UINT64>(p - (text + 1));
    // An unclosed quote runs to the terminator, and scanning stops there.
    return *p == '"' ? p + 1 : p;
  }
  const char *p = text;
  while (*p != '\0' && !IsBlank(*p) && *p != '=') {
    p++;
  }
  *start = text;
  *length = static_cast<UINT64>(p - text);
  return p;
}

// A null text holds no key: a caller whose option string could not be made
// looks it up like an empty one.
EFI_STATUS GetOptionValue(const char *text, const char *key, const char **value, UINT64 *length) {
  EFI_STATUS result = EFI_NOT_FOUND;
  if (text == nullptr) {
    return result;
  }
  const UINT64 keyLength = strlen(key);
  const char *cursor = text;
  while (*cursor != '\0') {
    cursor = SkipBlanks(cursor);
    const char *pairKey;
    UINT64 pairKeyLength;
    cursor = ScanOptionWord(cursor, &pairKey, &pairKeyLength);
    const char *pairValue = cursor;
    UINT64 pairValueLength = 0;
    if (*cursor != '\0' && !IsBlank(*cursor)) {
      // The separator, '=' unless the key was quoted, whatever it is.
      cursor = ScanOptionWord(cursor + 1, &pairValue, &pairValueLength);
    }
    if (pairKeyLength == keyLength && KeyEquals(pairKey, key, keyLength)) {
      // No early stop: the last occurrence of a key wins.
      *value = pairValue;
      *length = pairValueLength;
      result = EFI_SUCCESS;
    }
  }
  return result;
}

const char *GetConfigValue(const char *key) {
  const PlistTag *tag = PlistFindKey(gConfigDict, key);
  return tag != nullptr ? tag->text : nullptr;
}

// A key whose value in the dictionary isn't a string (a null text) counts
// as not found.
EFI_STATUS GetOptionOrConfigValue(const char *text, const char *key, const char **value, UINT64 *length) {
  if (!EFI_ERROR(GetOptionValue(text, key, value, length))) {
    return EFI_SUCCESS;
  }
  const char *configValue = GetConfigValue(key);
  if (configValue == nullptr) {
    return EFI_NOT_FOUND;
  }
  *value = configValue;
  *length = strlen(configValue);
  return EFI_SUCCESS;
}

const char *NextOption(const char *text, const char **word, UINT64 *keyLength, UINT64 *wordLength) {
  const char *start = SkipBlanks(text);
  const char *equals = nullptr;
  const char *p = start;
  while (*p != '\0' && !IsBlank(*p)) {
    if (*p == '=' && equals == nullptr) {
      equals = p;
    }
    p++;
  }
  *word = start;
  *wordLength = static_cast<UINT64>(p - start);
  *keyLength = static_cast<UINT64>((equals != nullptr ? equals : p) - start);
  return p;
}

// True when the word of the text at `textWord` begins with the `keyLength`
// bytes of `key`, case kept, and the byte behind them ends the key.
static BOOLEAN HasKey(const char *textWord, const char *key, UINT64 keyLength) {
  for (UINT64 i = 0; i < keyLength; i++) {
    if (textWord[i] == '\0' || textWord[i] != key[i]) {
      return FALSE;
    }
  }
  const char behind = textWord[keyLength];
  return behind == '\0' || behind == '=' || IsBlank(behind);
}

// `word` of `wordLength` bytes behind the string that ends at `end`, with a
// blank in front when the string is not empty.
static char *AppendWord(char *base, char *end, const char *word, UINT64 wordLength) {
  if (base < end) {
    *end++ = ' ';
  }
  memcpy(end, word, wordLength);
  end[wordLength] = '\0';
  return end + wordLength;
}

UINT64 CountOptionWords(const char *text) {
  UINT64 count = 0;
  while (*SkipBlanks(text) != '\0') {
    const char *word = nullptr;
    UINT64 keyLength = 0;
    UINT64 wordLength = 0;
    text = NextOption(text, &word, &keyLength, &wordLength);
    count++;
  }
  return count;
}

// A word's key is what stands in front of its first '='; two words are
// duplicates when their keys are the same non-empty bytes.
static UINT64 KeyHash(const char *key, UINT64 keyLength) {
  UINT64 hash = 0xCBF29CE484222325ULL;
  for (UINT64 i = 0; i < keyLength; i++) {
    hash = (hash ^ static_cast<UINT8>(key[i])) * 0x100000001B3ULL;
  }
  return hash;
}

// The slot that holds the key, or the free slot where it would go.
static UINT32 *KeySlot(const OptionKeyIndex *index, const char *key, UINT64 keyLength) {
  for (UINT64 i = KeyHash(key, keyLength);; i++) {
    UINT32 *slot = &index->slots[i & index->mask];
    if (*slot == 0 || HasKey(index->base + *slot - 1, key, keyLength)) {
      return slot;
    }
  }
}

static void IndexKey(OptionKeyIndex *index, const char *word, UINT64 keyLength) {
  if (keyLength != 0) {
    UINT32 *slot = KeySlot(index, word, keyLength);
    if (*slot == 0) {
      *slot = static_cast<UINT32>(word - index->base) + 1;
    }
  }
}

void OptionKeyIndexInit(OptionKeyIndex *index, char *base, UINT64 bytes, UINT64 words) {
  index->base = base;
  index->slots = nullptr;
  index->mask = 0;
  if (bytes >= 0xFFFFFFFF || words > bytes) {
    return;
  }
  UINT64 slots = 16;
  while (slots < 2 * words) {
    slots *= 2;
  }
  index->slots = static_cast<UINT32 *>(TrackedAllocatePool(slots * sizeof(UINT32)));
  if (index->slots == nullptr) {
    return;
  }
  bzero(index->slots, slots * sizeof(UINT32));
  index->mask = slots - 1;
  for (const char *text = base; *SkipBlanks(text) != '\0';) {
    const char *word = nullptr;
    UINT64 keyLength = 0;
    UINT64 wordLength = 0;
    text = NextOption(text, &word, &keyLength, &wordLength);
    IndexKey(index, word, keyLength);
  }
}

void OptionKeyIndexFree(OptionKeyIndex *index) {
  if (index->slots != nullptr) {
    TrackedFree(index->slots);
    index->slots = nullptr;
  }
}

char *AppendIndexedOption(OptionKeyIndex *index, char *end, const char *word, UINT64 keyLength,
                          UINT64 wordLength) {
  if (index->slots == nullptr) {
    return AppendOption(index->base, end, word, keyLength, wordLength);
  }
  if (keyLength != 0 && *KeySlot(index, word, keyLength) != 0) {
    return end;
  }
  char *appended = AppendWord(index->base, end, word, wordLength);
  IndexKey(index, appended - wordLength, keyLength);
  return appended;
}

char *AppendOption(char *base, char *end, const char *word, UINT64 keyLength, UINT64 wordLength) {
  if (keyLength != 0) {
    const char *p = base;
    while (*p != '\0') {
      p = SkipBlanks(p);
      if (*p == '\0') {
        break;
      }
      if (HasKey(p, word, keyLength)) {
        return end;
      }
      while (*p != '\0' && !IsBlank(*p)) {
        p++;
      }
    }
  }
  return AppendWord(base, end, word, wordLength);
}

}  // namespace nimb
