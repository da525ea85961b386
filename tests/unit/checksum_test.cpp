// MD5 against the published test suite, fed whole and in pieces, and
// Adler-32 against a plain reference computed here.
#include "support/checksum.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstdio>
#include <string>
#include <vector>

namespace {

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
  char digits[3];
  for (UINT8 byte : digest) {
    std::snprintf(digits, sizeof(digits), "%02x", byte);
    out += digits;
  }
  // Final leaves nothing of the message behind.
  const UINT8 *bytes = reinterpret_cast<const UINT8 *>(&context);
  EXPECT_EQ(std::vector<UINT8>(bytes, bytes + sizeof(context)), std::vector<UINT8>(sizeof(context), 0));
  return out;
}

TEST(Md5Test, PublishedSuiteWholeAndInPiecesAcrossBlockBoundaries) {
  struct Row {
    std::string text;
    const char *digest;
  };
  const Row rows[] = {
      {"", "d41d8cd98f00b204e9800998ecf8427e"},
      {"abc", "900150983cd24fb0d6963f7d28e17f72"},
      {"abcdefghijklmnopqrstuvwxyz", "c3fcd3d76192e4007dfb496cca67e13b"},
      {"12345678901234567890123456789012345678901234567890123456789012345678901234567890",
       "57edf4a22be3c955ac49da2e2107b67a"},
  };
  for (const Row &row : rows) {
    for (size_t piece : {0, 1, 63, 65})
      EXPECT_EQ(Md5(row.text, piece), row.digest) << "\"" << row.text << "\" in pieces of " << piece;
  }
}

TEST(Md5Test, PaddingAtTheLengthsAroundOneBlock) {
  // Runs of 'a' where padding takes one block or two, and a million of them
  // (a bit count above 2^22).
  struct Row {
    size_t length;
    const char *digest;
  };
  const Row rows[] = {
      {55, "ef1772b6dff9a122358552954ad0df65"},  {56, "3b0c8ac703f828b04c6c197006d17218"},
      {64, "014842d480b571495a4a0363793f7367"},  {119, "8a7bd0732ed6a28ce75f6dabc90e1613"},
      {120, "5f61c0ccad4cac44c75ff505e1f1e537"}, {1000000, "7707d6ae4e027c70eea2a935c2296f21"},
  };
  for (const Row &row : rows) {
    const std::string text(row.length, 'a');
    EXPECT_EQ(Md5(text, 0), row.digest) << row.length;
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
