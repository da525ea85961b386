#include "support/strings.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <string>
#include <vector>

#include "support/checksum.h"

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
  char bytes[6] = "#####", target[8] = "#######";
  EXPECT_EQ(nimb::strncpy(bytes, "ab", 4), bytes);
  EXPECT_EQ(nimb::strcpy(target, "abc"), target);
  EXPECT_EQ(std::string(bytes, 6) + std::string(target, 8), std::string("ab\0##\0abc\0###\0", 14));
  EXPECT_EQ(nimb::strlen("abc\0def"), 3u);
}

TEST(StringsTest, WideStringsAndGuids) {
  EXPECT_EQ(nimb::StrLen(u"a\u4E2Dc"), 3u);
  CHAR16 buffer[6] = {9, 9, 9, 9, 9, 9};
  nimb::StrCpy(buffer, u"ab");
  EXPECT_EQ(std::u16string(buffer, 6), std::u16string(u"ab\0\x09\x09\x09", 6));

  EXPECT_EQ(nimb::StrCmp(u"abc", u"abc"), 0);
  EXPECT_EQ(nimb::StrCmp(u"ab", u"abc"), -'c');
  EXPECT_EQ(nimb::StrCmp(u"\xFFFF", u"a"), 0xFFFF - 'a') << "units read as unsigned";

  // CompareGuid looks at all sixteen bytes.
  const EFI_GUID base = {0x12345678, 0x9ABC, 0xDEF0, {1, 2, 3, 4, 5, 6, 7, 8}};
  EFI_GUID same = base;
  EXPECT_EQ(nimb::CompareGuid(&base, &same), TRUE);
  for (size_t i = 0; i < sizeof(EFI_GUID); i++) {
    EFI_GUID other = base;
    reinterpret_cast<UINT8 *>(&other)[i] ^= 0x40;
    EXPECT_EQ(nimb::CompareGuid(&base, &other), FALSE) << "byte " << i;
  }
}

// MD5 of `text` fed in pieces of `piece` bytes (0: in one call), in hex.
std::string Md5(const std::string &text, size_t piece) {
  nimb::Md5Context context;
  nimb::Md5Init(&context);
  if (piece == 0)
    piece = text.size() + 1;
  for (size_t at = 0; at < text.size() || at == 0; at += piece)
    nimb::Md5Update(&context, text.data() + at, static_cast<UINT32>(std::min(piece, text.size() - at)));
  UINT8 digest[16];
  nimb::Md5Final(digest, &context);
  std::string out;
  for (UINT8 byte : digest)
    out += {"0123456789abcdef"[byte >> 4], "0123456789abcdef"[byte & 15]};
  // Final leaves nothing of the message behind.
  const UINT8 *bytes = reinterpret_cast<const UINT8 *>(&context);
  EXPECT_EQ(std::vector<UINT8>(bytes, bytes + sizeof(context)), std::vector<UINT8>(sizeof(context), 0));
  return out;
}

// The published suite, and runs of 'a' where padding takes one block or two
// (a million: a bit count above 2^22), whole and in pieces.
TEST(Md5Test, PublishedSuiteAndPaddingAroundOneBlock) {
  const std::string digits =
      "12345678901234567890123456789012345678901234567890123456789012345678901234567890";
  const std::pair<std::string, const char *> rows[] = {
      {"", "d41d8cd98f00b204e9800998ecf8427e"},
      {"abc", "900150983cd24fb0d6963f7d28e17f72"},
      {"abcdefghijklmnopqrstuvwxyz", "c3fcd3d76192e4007dfb496cca67e13b"},
      {digits, "57edf4a22be3c955ac49da2e2107b67a"},
      {std::string(55, 'a'), "ef1772b6dff9a122358552954ad0df65"},
      {std::string(56, 'a'), "3b0c8ac703f828b04c6c197006d17218"},
      {std::string(64, 'a'), "014842d480b571495a4a0363793f7367"},
      {std::string(119, 'a'), "8a7bd0732ed6a28ce75f6dabc90e1613"},
      {std::string(120, 'a'), "5f61c0ccad4cac44c75ff505e1f1e537"},
      {std::string(1000000, 'a'), "7707d6ae4e027c70eea2a935c2296f21"},
  };
  for (const auto &[text, digest] : rows) {
    for (size_t piece : {0, 1, 63, 65})
      EXPECT_EQ(Md5(text, piece), digest) << text.size() << " bytes in pieces of " << piece;
  }
}

TEST(Md5Test, TheBitCountCarriesIntoItsHighWord) {
  struct Row {
    UINT32 low;  // bit count before the update
    UINT32 length;
    UINT32 expectedLow;
    UINT32 expectedHigh;
  };
  const Row rows[] = {{0xFFFFFFF8, 1, 0, 1}, {0xFFFFFF00, 64, 0x100, 1}, {0xFFFFFE00, 63, 0xFFFFFFF8, 0}};
  const std::string data(64, 'x');
  for (const Row &row : rows) {
    nimb::Md5Context context;
    nimb::Md5Init(&context);
    context.count[0] = row.low;
    nimb::Md5Update(&context, data.data(), row.length);
    EXPECT_EQ(context.count[0], row.expectedLow) << row.low;
    EXPECT_EQ(context.count[1], row.expectedHigh) << row.low;
  }
}

TEST(Adler32Test, ByteReversedAndReducedInTime) {
  EXPECT_EQ(nimb::Adler32("abc", 3), 0x27014D02u);
  EXPECT_EQ(nimb::Adler32(nullptr, 0), 0x01000000u);
  // All 0xFF is the input that overflows first; bytes that differ weigh each
  // place of a word. The reference reduces after every byte.
  for (size_t length : {5001, 100003, (1 << 20) + 77}) {
    std::vector<UINT8> data(length, 0xFF);
    if (length > 100003) {
      for (size_t i = 0; i < length; i++)
        data[i] = static_cast<UINT8>(i * 7919 >> 3);
    }
    UINT64 s1 = 1, s2 = 0;
    for (UINT8 byte : data) {
      s1 = (s1 + byte) % 65521;
      s2 = (s2 + s1) % 65521;
    }
    const UINT32 sum = static_cast<UINT32>((s2 << 16) | s1);
    EXPECT_EQ(nimb::Adler32(data.data(), data.size()), __builtin_bswap32(sum)) << length;
  }
}

}  // namespace
