// Option strings: the quote-aware key lookup, the blank-split word reader and
// the appending of words without duplicate keys, and the configuration
// dictionary as second source.
#include "config/options.h"

#include <gtest/gtest.h>

#include <cstring>
#include <string>
#include <vector>

#include "config/boot_options.h"
#include "config/plist.h"
#include "loader_fixture.h"

namespace {

constexpr size_t kNone = static_cast<size_t>(-1);

TEST(OptionsTest, GetOptionValueFindsTheLastPairWithTheKey) {
  struct Row {
    const char *text;
    const char *key;
    size_t offset;  // where the value starts in `text`; kNone when not found
    const char *value;
  };
  const Row rows[] = {
      {" \t\r\n", "-v", kNone, ""},
      {"-v", "-v", 2, ""},
      {"-vx", "-v", kNone, ""},
      {"-x -v", "-x", 2, ""},
      {"a=\"b c\"", "a", 3, "b c"},
      {"a=\"b c\" d=1", "d", 10, "1"},
      {"\"a b\"=c", "a b", 6, "c"},
      {"\"a\"x=1", "a", 4, ""},  // the byte behind a quoted key is a separator
      {"a=\"b", "a", 3, "b"},
      {"a=1 a=2", "a", 6, "2"},
      {"a=b=c", "a", 2, "b"},
      {"a=b=c", "", 4, "c"},
      {"configure=1", "config", kNone, ""},
      {"[=1", "{", 2, "1"},
      {"a=\"-v b\"", "-v", kNone, ""},
      {"a\tb\r\nc", "c", 6, ""},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(std::string("text \"") + row.text + "\" key \"" + row.key + "\"");
    const char *value = nullptr;
    UINT64 length = 12345;
    const EFI_STATUS status = nimb::GetOptionValue(row.text, row.key, &value, &length);
    if (row.offset == kNone) {
      EXPECT_EQ(status, EFI_NOT_FOUND);
      EXPECT_EQ(value, nullptr);  // outs untouched
      EXPECT_EQ(length, 12345u);
      continue;
    }
    ASSERT_EQ(status, EFI_SUCCESS);
    EXPECT_EQ(value, row.text + row.offset);
    EXPECT_EQ(std::string(value, length), row.value);
  }
}

// Word and key, as NextOption splits `text` up to the terminator.
using Words = std::vector<std::pair<std::string, std::string>>;
Words Split(const char *text) {
  Words words;
  while (*text != '\0') {
    const char *word = nullptr;
    UINT64 keyLength = 0;
    UINT64 wordLength = 0;
    const char *next = nimb::NextOption(text, &word, &keyLength, &wordLength);
    EXPECT_EQ(next, word + wordLength);
    words.push_back({std::string(word, wordLength), std::string(word, keyLength)});
    text = next;
  }
  return words;
}

class OptionsAppendTest : public nimbtest::LoaderTest {};

// The same rows with the plain search and with the key index.
TEST_F(OptionsAppendTest, AppendOptionDropsWordsWhoseKeyIsInTheTextAlready) {
  struct Row {
    const char *base;
    std::vector<const char *> sources;  // each split into words with NextOption
    const char *result;
  };
  const Row rows[] = {
      {"", {"a b"}, "a b"},
      {"-v", {"-v"}, "-v"},
      {"-v", {"-v=1"}, "-v"},
      {"-vx", {"-v"}, "-vx -v"},
      {"-V", {"-v"}, "-V -v"},
      {"x\t-v\r\n", {"-v"}, "x\t-v\r\n"},
      {"a=\"x -v y\"", {"-v"}, "a=\"x -v y\""},
      {"", {"a=\"b c\" a=1"}, "a=\"b c\""},
      {"=x", {"=x"}, "=x =x"},
      {"x", {"a b "}, "x a b "},
      {"-v foo=1", {"foo=2 bar=3 -v", "baz=4 bar=5"}, "-v foo=1 bar=3 baz=4"},
  };
  for (const Row &row : rows) {
    for (bool indexed : {false, true}) {
      SCOPED_TRACE(std::string("base \"") + row.base + "\"" + (indexed ? ", indexed" : ""));
      std::vector<char> buffer(256, '\x55');
      std::strcpy(buffer.data(), row.base);
      char *end = buffer.data() + strlen(row.base);
      nimb::OptionKeyIndex index;
      nimb::OptionKeyIndexInit(&index, buffer.data(), buffer.size(), indexed ? 16 : 0x7FFFFFFF);
      ASSERT_EQ(index.slots != nullptr, indexed);
      for (const char *source : row.sources) {
        for (const auto &[word, key] : Split(source))
          end = nimb::AppendIndexedOption(&index, end, word.c_str(), key.size(), word.size());
      }
      nimb::OptionKeyIndexFree(&index);
      EXPECT_STREQ(buffer.data(), row.result);
      EXPECT_EQ(end, buffer.data() + strlen(row.result));
      // Nothing is written behind the terminator.
      EXPECT_EQ(end[1], '\x55');
    }
  }
}

// The configuration dictionary as second source, parsed from a document as
// the boot options do.
class OptionsConfigTest : public nimbtest::LoaderTest {};

TEST_F(OptionsConfigTest, TheOptionStringBeatsTheDictionaryKeyByKey) {
  const char *value = nullptr;
  UINT64 length = 0;
  EXPECT_EQ(nimb::GetOptionOrConfigValue("a=1", "Kernel", &value, &length), EFI_NOT_FOUND) << "no dictionary";
  EXPECT_EQ(nimb::GetConfigValue("Kernel"), nullptr);
  std::string document =
      "<plist><dict>"
      "<key>Kernel</key><string>nimb_other</string>"
      "<key>Empty</key><string></string>"
      "<key>Root UUID</key><integer>5</integer>"
      "<key>Sub</key><dict><key>Kernel</key><string>nested</string></dict>"
      "</dict></plist>";
  ASSERT_EQ(nimb::PlistParseDocument(document.data(), &nimb::gConfigDict), EFI_SUCCESS);
  struct Row {
    const char *text;
    const char *key;
    const char *value;  // null when not found
    bool fromOptions;   // the value points into `text`
  };
  const Row rows[] = {
      {"", "Kernel", "nimb_other", false},
      {"Kernel=a", "Kernel", "a", true},
      {"kernel=a", "Kernel", "a", true},
      {"Kernels=a", "Kernel", "nimb_other", false},
      {"", "kernel", nullptr, false},  // the dictionary's keys match exactly
      {nullptr, "Kernel", "nimb_other", false},
      {"", "Empty", "", false},
      {"", "Root UUID", nullptr, false},  // not a string
      {"rd", "rd", "", true},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(std::string("text \"") + (row.text != nullptr ? row.text : "(null)") + "\" key \"" +
                 row.key + "\"");
    const EFI_STATUS status = nimb::GetOptionOrConfigValue(row.text, row.key, &value, &length);
    if (row.value == nullptr) {
      EXPECT_EQ(status, EFI_NOT_FOUND);
      continue;
    }
    ASSERT_EQ(status, EFI_SUCCESS);
    EXPECT_EQ(std::string(value, length), row.value);
    if (row.fromOptions) {
      EXPECT_TRUE(value >= row.text && value <= row.text + strlen(row.text));
    } else {
      EXPECT_STREQ(nimb::GetConfigValue(row.key), row.value);
    }
  }
}

}  // namespace
