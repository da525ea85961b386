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
      {"0X1f", 0, 31, 4},
      {"0x10", 8, 0, 1},
      {"0777", 0, 511, 4},
      {"099", 0, 0, 1},
      {" \t\n42z", 10, 42, 5},
      {"\v42", 10, 0, 0},
      {"-1", 10, kAllOnes, 2},
      {"0x", 16, 0, 0},
      {"zZ", 36, 35 * 36 + 35, 2},
      {"12", 37, 0, 0},
      {"-18446744073709551615", 10, 1, 21},
      {"18446744073709551616", 10, kAllOnes, 20},
      {"-18446744073709551616", 10, kAllOnes, 21},
      {"10000000000000000x", 16, kAllOnes, 17},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(std::string("\"") + row.text + "\" base " + std::to_string(row.base));
    char *end = nullptr;
    EXPECT_EQ(nimb::strtoul(row.text, &end, row.base), row.value);
    EXPECT_EQ(end - row.text, static_cast<ptrdiff_t>(row.end));
  }
}

TEST(StringsTest, ComparisonsGiveSignedByteDifferences) {
  enum Kind { kStrcmp, kStrncmp, kStrncasecmp };
  struct Row {
    Kind kind;
    const char *a;
    const char *b;
    INT32 count;
    int result;
  };
  const Row rows[] = {
      {kStrcmp, "abc", "abd", 0, -1},
      {kStrcmp, "\x80", "\x01", 0, -129},
      {kStrncmp, "abc", "abd", 2, 0},
      {kStrncmp, "\x80", "\x01", 1, -129},
      {kStrncmp, "abc", "xyz", INT32_MIN, 0},
      // Bit 5 is cleared in every character: '[' is '{', a blank is a NUL.
      {kStrncasecmp, "x", "x ", 2, 0},
      {kStrncasecmp, "[", "{", 1, 0},
      {kStrncasecmp, "abc", "ABX", 3, 'C' - 'X'},
      {kStrncasecmp, "ab", "abc", 3, -'C'},
      {kStrncasecmp, "\xC1", "A", 1, -63 - 'A'},  // 0xC1 reads as the signed byte -63
      {kStrncasecmp, "abc", "xyz", -1, 0},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(std::string("\"") + row.a + "\" vs \"" + row.b + "\" count " + std::to_string(row.count));
    const int result = row.kind == kStrcmp    ? nimb::strcmp(row.a, row.b)
                       : row.kind == kStrncmp ? nimb::strncmp(row.a, row.b, row.count)
                                              : nimb::strncasecmp(row.a, row.b, row.count);
    EXPECT_EQ(result, row.result) << row.kind;
  }
}

TEST(StringsTest, MemcmpFindsTheFirstDifferenceOnBothPaths) {
  struct Row {
    const char *name;
    size_t offset;  // from an 8-aligned base; non-zero takes the byte path
    UINTN count;
    std::vector<std::pair<size_t, UINT8>> changes;  // bytes of `b` that differ from 0x10
    int result;
  };
  const Row rows[] = {
      {"empty", 0, 0, {{0, 0x11}}, 0},
      {"middle of the second word, signed", 0, 32, {{13, 0x90}}, 0x10 - (-0x70)},
      {"low byte decides, not the word", 0, 16, {{8, 0x11}, {15, 0x00}}, -1},
      {"unaligned", 1, 24, {{14, 0x90}}, 0x80},
      {"count not a multiple of 8", 0, 13, {{12, 0x0F}}, 1},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(row.name);
    alignas(8) UINT8 a[48];
    alignas(8) UINT8 b[48];
    std::memset(a, 0x10, sizeof a);
    std::memset(b, 0x10, sizeof b);
    for (const auto &change : row.changes)
      b[row.offset + change.first] = change.second;
    EXPECT_EQ(nimb::memcmp(a + row.offset, b + row.offset, row.count), row.result);
    EXPECT_EQ(nimb::memcmp(b + row.offset, a + row.offset, row.count), -row.result);
  }
}

TEST(StringsTest, MemoryAndCopyRoutines) {
  UINT8 buffer[8];
  std::memset(buffer, 0xEE, sizeof buffer);
  EXPECT_EQ(nimb::memset(buffer + 1, 0x1234, 3), buffer + 1);
  nimb::bzero(buffer + 2, 4);
  EXPECT_EQ(std::vector<UINT8>(buffer, buffer + 8), (std::vector<UINT8>{0xEE, 0x34, 0, 0, 0, 0, 0xEE, 0xEE}));

  // Source first, copied forward: an overlapping destination above the
  // source is overwritten by its own copy.
  char text[9] = "abcdefgh";
  nimb::bcopy(text, text + 2, 6);
  EXPECT_STREQ(text, "abababab");
  // The copy gives the bytes of the upward byte loop for every overlap.
  for (int distance = -10; distance <= 10; distance++) {
    for (UINTN count = 0; count <= 40; count++) {
      UINT8 mine[64], theirs[64];
      for (int i = 0; i < 64; i++)
        mine[i] = theirs[i] = static_cast<UINT8>(i * 7 + 1);
      UINT8 *from = theirs + 12;
      for (UINTN i = 0; i < count; i++)
        from[distance + static_cast<int>(i)] = from[i];
      nimb::memcpy(mine + 12 + distance, mine + 12, count);
      ASSERT_EQ(0, std::memcmp(mine, theirs, sizeof mine)) << "distance " << distance << " count " << count;
    }
  }
  // memmove is right for overlap either way.
  char up[9] = "abcdefgh", down[9] = "abcdefgh";
  EXPECT_EQ(nimb::memmove(up + 2, up, 6), up + 2);
  nimb::memmove(down, down + 2, 6);
  EXPECT_STREQ(up, "ababcdef");
  EXPECT_STREQ(down, "cdefghgh");

  // strncpy never pads.
  char bytes[6] = "#####";
  EXPECT_EQ(nimb::strncpy(bytes, "ab", 4), bytes);
  EXPECT_EQ(std::string(bytes, 6), std::string("ab\0##\0", 6));
  char target[8] = "#######";
  EXPECT_EQ(nimb::strcpy(target, "abc"), target);
  EXPECT_EQ(std::string(target, 8), std::string("abc\0###\0", 8));
  EXPECT_EQ(nimb::strlen("abc\0def"), 3u);
}

TEST(StringsTest, WideStrings) {
  EXPECT_EQ(nimb::StrLen(u"a\u4E2Dc"), 3u);
  CHAR16 buffer[6] = {9, 9, 9, 9, 9, 9};
  nimb::StrCpy(buffer, u"ab");
  EXPECT_EQ(std::u16string(buffer, 6), std::u16string(u"ab\0\x09\x09\x09", 6));

  EXPECT_EQ(nimb::StrCmp(u"abc", u"abc"), 0);
  EXPECT_EQ(nimb::StrCmp(u"ab", u"abc"), -'c');
  EXPECT_EQ(nimb::StrCmp(u"\xFFFF", u"a"), 0xFFFF - 'a') << "units read as unsigned";
}

TEST(StringsTest, CompareGuidLooksAtAllSixteenBytes) {
  const EFI_GUID base = {0x12345678, 0x9ABC, 0xDEF0, {1, 2, 3, 4, 5, 6, 7, 8}};
  EFI_GUID same = base;
  EXPECT_EQ(nimb::CompareGuid(&base, &same), TRUE);
  for (size_t i = 0; i < sizeof(EFI_GUID); i++) {
    EFI_GUID other = base;
    reinterpret_cast<UINT8 *>(&other)[i] ^= 0x40;
    EXPECT_EQ(nimb::CompareGuid(&base, &other), FALSE) << "byte " << i;
  }
}

}  // namespace
