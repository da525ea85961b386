// Arbitrary bytes as an option string and as a device path.
//
// The option string (the input up to its first NUL, in a buffer of exactly
// that size) goes through the key lookup for a few keys, is split into words,
// and every word is appended into a buffer of exactly the size the boot
// options give it: the sum of the word lengths, 64, and one byte per word.
// AddressSanitizer sees any read or write past either buffer; the result must
// hold no two words with the same key.
//
// The whole input is also walked as a device path bounded by its size.

#include "config/options.h"
#include "fuzz_firmware.h"
#include "support/devicepath.h"

struct Word {
  const char *word;
  UINT64 keyLength;
  UINT64 wordLength;
};

void LookUpKeys(const char *text, size_t length) {
  static const char *const kKeys[] = {"-v", "-x", "Kernel", "Drvpk Cache", "a", ""};
  for (const char *key : kKeys) {
    const char *value = nullptr;
    UINT64 valueLength = 0;
    if (!EFI_ERROR(nimb::GetOptionValue(text, key, &value, &valueLength))) {
      Check(value >= text && value + valueLength <= text + length);
    }
  }
}

std::vector<Word> SplitWords(const char *text, size_t length) {
  std::vector<Word> words;
  const char *p = text;
  while (*p != '\0') {
    Word w;
    const char *next = nimb::NextOption(p, &w.word, &w.keyLength, &w.wordLength);
    Check(next > p && next <= text + length);
    Check(w.keyLength <= w.wordLength && w.word + w.wordLength == next);
    words.push_back(w);
    p = next;
  }
  return words;
}

// True when the text word at `word` has the key of `w`, as AppendOption
// defines a duplicate.
bool SameKey(const char *word, const Word &w) {
  if (w.keyLength == 0 || strncmp(word, w.word, w.keyLength) != 0)
    return false;
  const char behind = word[w.keyLength];
  return behind == '\0' || behind == '=' || behind == ' ' || behind == '\t' || behind == '\r' ||
         behind == '\n';
}

void AppendWords(const std::vector<Word> &words) {
  size_t size = 64;
  for (const Word &w : words)
    size += w.wordLength + 1;
  std::unique_ptr<char[]> buffer(new char[size]());
  char *base = buffer.get(), *end = base;
  for (const Word &w : words) {
    end = nimb::AppendOption(base, end, w.word, w.keyLength, w.wordLength);
    Check(end >= base && end < base + size && *end == '\0');
  }
  // The indexed appends give the same string, from a first word on as the
  // merge of the boot options starts.
  std::unique_ptr<char[]> indexedBuffer(new char[size]());
  char *indexedBase = indexedBuffer.get(), *indexedEnd = indexedBase;
  if (!words.empty())
    indexedEnd = std::copy_n(words[0].word, words[0].wordLength, indexedBase);
  nimb::OptionKeyIndex index;
  nimb::OptionKeyIndexInit(&index, indexedBase, size, words.size() + 1);
  for (size_t i = 1; i < words.size(); i++)
    indexedEnd =
        nimb::AppendIndexedOption(&index, indexedEnd, words[i].word, words[i].keyLength, words[i].wordLength);
  nimb::OptionKeyIndexFree(&index);
  Check(strcmp(indexedBase, base) == 0 && indexedEnd == indexedBase + (end - base));
  // No word of the result has the key of a word behind it.
  std::vector<Word> kept = SplitWords(base, static_cast<size_t>(end - base));
  for (size_t j = 0; j < kept.size(); j++) {
    for (size_t i = 0; i < j; i++) {
      Check(!SameKey(kept[i].word, kept[j]));
    }
  }
}

void WalkDevicePath(const uint8_t *data, size_t size) {
  const auto *path = reinterpret_cast<const EFI_DEVICE_PATH_PROTOCOL *>(data);
  UINTN remaining = size;
  size_t nodes = 0;
  const EFI_DEVICE_PATH_PROTOCOL *node = nimb::DevicePathFirstNode(size != 0 ? path : nullptr, &remaining);
  for (; node != nullptr && !nimb::IsDevicePathEnd(node); node = nimb::DevicePathNextNode(node, &remaining)) {
    Check(++nodes <= size / 4);
  }
  const UINTN pathSize = nimb::DevicePathSizeWithin(size != 0 ? path : nullptr, size);
  Check(pathSize <= size && (pathSize == 0) == (node == nullptr));
  const UINT8 kinds[][2] = {{3, 11}, {4, 4}, {4, 1}, {0x7F, 0x01}};
  for (const auto &kind : kinds) {
    const auto *found = nimb::DevicePathFindNode(size != 0 ? path : nullptr, size, kind[0], kind[1]);
    if (found != nullptr) {
      const auto *at = reinterpret_cast<const uint8_t *>(found);
      Check(at >= data && at + nimb::DevicePathNodeLength(found) <= data + size);
    }
  }
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  const size_t length = strnlen(reinterpret_cast<const char *>(data), size);
  std::unique_ptr<char[]> text(new char[length + 1]);
  memcpy(text.get(), data, length);
  text[length] = '\0';

  static hostfw::Firmware *fw = new hostfw::Firmware;
  nimbfuzz::AttachLoader(*fw);
  LookUpKeys(text.get(), length);
  AppendWords(SplitWords(text.get(), length));
  nimb::TrackedFreeAll();
  Check(fw->LivePoolBlocks() == 0);
  WalkDevicePath(data, size);
  return 0;
}
