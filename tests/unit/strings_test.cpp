#include "support/strings.h"

#include <gtest/gtest.h>

#include <cstring>
#include <string>
#include <vector>

namespace {

constexpr UINT64 kAllOnes = 0xFFFFFFFFFFFFFFFFULL;

TEST(StringsTest, StrtoulBasesSignsPrefixesAndEnd) {
  struct Row {
    const char *text;
    INT32 base;
    UINT64 value;
    size_t end;  // offset of the first character not used
  };
  const Row rows[] = {
      {"0x10", 16, 16, 4},
      {"0x10", 0, 16, 4},
      {"0X1f", 0, 31, 4},
      {"0x10", 10, 0, 1},
      {"0x10", 8, 0, 1},
      {"0777", 0, 511, 4},
      {"099", 0, 0, 1},
      {"99", 0, 99, 2},
      {" \t\n42z", 10, 42, 5},
      {"\v42", 10, 0, 0},
      {"+7", 10, 7, 2},
      {"-1", 10, kAllOnes, 2},
      {"-10", 16, 0xFFFFFFFFFFFFFFF0ULL, 3},
      {"-", 10, 0, 0},
      {"0x", 16, 0, 0},
      {"0xg", 0, 0, 0},
      {"zZ", 36, 35 * 36 + 35, 2},
      {"12", 37, 0, 0},
      {"101", 2, 5, 3},
      {"ffffffffffffffff", 16, kAllOnes, 16},
      {"18446744073709551615", 10, kAllOnes, 20},
      {"-18446744073709551615", 10, 1, 21},
      {"18446744073709551616", 10, kAllOnes, 20},
      {"-18446744073709551616", 10, kAllOnes, 21},
      {"99999999999999999999", 10, kAllOnes, 20},
      {"10000000000000000x", 16, kAllOnes, 17},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(std::string("\"") + row.text + "\" base " + std::to_string(row.base));
    char *end = nullptr;
    EXPECT_EQ(nimb::strtoul(row.text, &end, row.base), row.value);
    EXPECT_EQ(end - row.text, static_cast<ptrdiff_t>(row.end));
    EXPECT_EQ(nimb::strtoul(row.text, nullptr, row.base), row.value);
  }
}

TEST(StringsTest, StrncasecmpClearsBitFiveOfEveryCharacter) {
  struct Row {
    const char *a;
    const char *b;
    INT32 count;
    int result;
  };
  const Row rows[] = {
      {"boot", "BOOT", 4, 0}, {"x", "x ", 2, 0},  // the NUL of `a` equals the blank, and ends it
      {"[", "{", 1, 0},       {"\xE0", "\xC0", 1, 0},
      {"abc", "ABX", 2, 0},   {"abc", "ABX", 3, 'C' - 'X'},
      {"b", "A", 1, 1},       {"ab", "abc", 3, -'C'},
      {"abc", "ab", 3, 'C'},  {"\xC1", "A", 1, -63 - 'A'},  // 0xC1 reads as the signed byte -63
      {"abc", "xyz", 0, 0},   {"abc", "xyz", -1, 0},
      {"abc", "abc", 100, 0},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(std::string("\"") + row.a + "\" vs \"" + row.b + "\" count " + std::to_string(row.count));
    EXPECT_EQ(nimb::strncasecmp(row.a, row.b, row.count), row.result);
  }
}

TEST(StringsTest, StrcmpAndStrncmpGiveSignedDifferences) {
  struct Row {
    const char *a;
    const char *b;
    INT32 count;  // below 0: strcmp
    int result;
  };
  const Row rows[] = {
      {"", "", -1, 0},          {"a", "", -1, 'a'},          {"", "a", -1, -'a'},
      {"abc", "abd", -1, -1},   {"\xFF", "a", -1, -1 - 'a'}, {"\x80", "\x01", -1, -129},
      {"abc", "abd", 3, -1},    {"abc", "abd", 2, 0},        {"a", "a", 5, 0},
      {"a", "A", 1, 'a' - 'A'}, {"\x80", "\x01", 1, -129},   {"ab", "abc", 3, -'c'},
      {"abc", "xyz", 0, 0},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(std::string("\"") + row.a + "\" vs \"" + row.b + "\" count " + std::to_string(row.count));
    if (row.count < 0) {
      EXPECT_EQ(nimb::strcmp(row.a, row.b), row.result);
    } else {
      EXPECT_EQ(nimb::strncmp(row.a, row.b, row.count), row.result);
    }
  }
  EXPECT_EQ(nimb::strncmp("abc", "xyz", -5), 0);
  EXPECT_EQ(nimb::strncmp("abc", "xyz", INT32_MIN), 0);
}

TEST(StringsTest, MemcmpFindsTheFirstDifferenceOnBothPaths) {
  struct Row {
    const char *name;
    size_t offset;  // from an 8-aligned base; non-zero takes the byte path
    UINTN count;
    std::vector<std::pair<size_t, UINT8>> changes;  // bytes of `b` that differ
    int result;
  };
  // `a` holds 0x10 everywhere; `b` is `a` with the changes.
  const Row rows[] = {
      {"equal, aligned", 0, 32, {}, 0},
      {"empty", 0, 0, {{0, 0x11}}, 0},
      {"middle of the second word", 0, 32, {{13, 0x90}}, 0x10 - (-0x70)},
      {"first of two in one word decides", 0, 32, {{10, 0x20}, {14, 0x01}}, 0x10 - 0x20},
      {"low byte decides, not the word", 0, 16, {{8, 0x11}, {15, 0x00}}, -1},
      {"last byte of the last word", 0, 24, {{23, 0x0F}}, 1},
      {"beyond the count", 0, 8, {{9, 0x00}}, 0},
      {"unaligned", 1, 24, {{14, 0x90}}, 0x80},
      {"count not a multiple of 8", 0, 13, {{12, 0x0F}}, 1},
      {"signed bytes", 0, 8, {{3, 0x7F}}, 0x10 - 0x7F},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(row.name);
    alignas(8) UINT8 a[48];
    alignas(8) UINT8 b[48];
    std::memset(a, 0x10, sizeof a);
    std::memset(b, 0x10, sizeof b);
    for (const auto &change : row.changes) {
      b[row.offset + change.first] = change.second;
    }
    EXPECT_EQ(nimb::memcmp(a + row.offset, b + row.offset, row.count), row.result);
    EXPECT_EQ(nimb::memcmp(b + row.offset, a + row.offset, row.count), -row.result);
  }
}

TEST(StringsTest, MemoryRoutines) {
  UINT8 buffer[8];
  std::memset(buffer, 0xEE, sizeof buffer);
  EXPECT_EQ(nimb::memset(buffer + 1, 0x1234, 3), buffer + 1);
  EXPECT_EQ(std::vector<UINT8>(buffer, buffer + 8),
            (std::vector<UINT8>{0xEE, 0x34, 0x34, 0x34, 0xEE, 0xEE, 0xEE, 0xEE}));

  nimb::bzero(buffer + 2, 4);
  EXPECT_EQ(std::vector<UINT8>(buffer, buffer + 8), (std::vector<UINT8>{0xEE, 0x34, 0, 0, 0, 0, 0xEE, 0xEE}));

  char copy[9] = "........";
  EXPECT_EQ(nimb::memcpy(copy + 1, "abc", 3), copy + 1);
  EXPECT_STREQ(copy, ".abc....");

  // Source first; an overlapping destination above the source is overwritten
  // by its own copy.
  char text[9] = "abcdefgh";
  nimb::bcopy(text, text + 2, 6);
  EXPECT_STREQ(text, "abababab");
  char target[4] = "xyz";
  nimb::bcopy("AB", target, 2);
  EXPECT_STREQ(target, "ABz");
}

TEST(StringsTest, StrncpyNeverPads) {
  struct Row {
    const char *source;
    UINTN count;
    const char *expected;  // the 6 bytes after the copy; the buffer starts as "######"
  };
  const Row rows[] = {
      {"ab", 4, "ab\0###"},    {"ab", 3, "ab\0###"}, {"ab", 2, "ab####"},
      {"abcdef", 4, "abcd##"}, {"", 4, "\0#####"},   {"abc", 0, "######"},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(std::string(row.source) + " count " + std::to_string(row.count));
    char buffer[6];
    std::memset(buffer, '#', sizeof buffer);
    EXPECT_EQ(nimb::strncpy(buffer, row.source, row.count), buffer);
    EXPECT_EQ(std::string(buffer, 6), std::string(row.expected, 6));
  }

  char buffer[8] = "#######";
  EXPECT_EQ(nimb::strcpy(buffer, "abc"), buffer);
  EXPECT_EQ(std::string(buffer, 8), std::string("abc\0###\0", 8));
  EXPECT_EQ(nimb::strlen(""), 0u);
  EXPECT_EQ(nimb::strlen("abc\0def"), 3u);
}

TEST(StringsTest, WideStrings) {
  EXPECT_EQ(nimb::StrLen(u""), 0u);
  EXPECT_EQ(nimb::StrLen(u"a\u4E2Dc"), 3u);

  CHAR16 buffer[6] = {9, 9, 9, 9, 9, 9};
  nimb::StrCpy(buffer, u"ab");
  EXPECT_EQ(std::u16string(buffer, 6), std::u16string(u"ab\0\x09\x09\x09", 6));

  struct Row {
    const CHAR16 *a;
    const CHAR16 *b;
    INT64 result;
  };
  const Row rows[] = {
      {u"", u"", 0},
      {u"abc", u"abc", 0},
      {u"abc", u"abd", -1},
      {u"ab", u"abc", -'c'},
      {u"\xFFFF", u"a", 0xFFFF - 'a'},  // units read as unsigned
      {u"a", u"\x8000", 'a' - 0x8000},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(testing::Message() << "row " << (&row - rows));
    EXPECT_EQ(nimb::StrCmp(row.a, row.b), row.result);
  }
}

TEST(StringsTest, CompareGuidLooksAtAllSixteenBytes) {
  const EFI_GUID base = {0x12345678, 0x9ABC, 0xDEF0, {1, 2, 3, 4, 5, 6, 7, 8}};
  EFI_GUID same = base;
  EXPECT_EQ(nimb::CompareGuid(&base, &same), TRUE);
  for (size_t i = 0; i < sizeof(EFI_GUID); i++) {
    SCOPED_TRACE(testing::Message() << "byte " << i);
    EFI_GUID other = base;
    reinterpret_cast<UINT8 *>(&other)[i] ^= 0x40;
    EXPECT_EQ(nimb::CompareGuid(&base, &other), FALSE);
  }
}

}  // namespace
