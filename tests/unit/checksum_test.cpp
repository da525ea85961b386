// MD5 against the published test suite, fed whole and in pieces, and
// Adler-32 against a plain reference computed here.
#include "support/checksum.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstdio>
#include <string>
#include <vector>

namespace {

std::string Hex(const UINT8 *bytes, size_t count) {
  std::string out;
  char digits[3];
  for (size_t i = 0; i < count; i++) {
    std::snprintf(digits, sizeof(digits), "%02x", bytes[i]);
    out += digits;
  }
  return out;
}

// MD5 of `text` fed in pieces of `piece` bytes (0: in one call).
std::string Md5(const std::string &text, size_t piece) {
  nimb::Md5Context context;
  nimb::Md5Init(&context);
  if (piece == 0) {
    nimb::Md5Update(&context, text.data(), static_cast<UINT32>(text.size()));
  } else {
    for (size_t at = 0; at < text.size(); at += piece) {
      const size_t n = std::min(piece, text.size() - at);
      nimb::Md5Update(&context, text.data() + at, static_cast<UINT32>(n));
    }
  }
  UINT8 digest[16];
  nimb::Md5Final(digest, &context);
  return Hex(digest, sizeof(digest));
}

struct Md5Row {
  std::string text;
  const char *digest;
};

const std::vector<Md5Row> &Md5Suite() {
  static const std::vector<Md5Row> rows = {
      {"", "d41d8cd98f00b204e9800998ecf8427e"},
      {"a", "0cc175b9c0f1b6a831c399e269772661"},
      {"abc", "900150983cd24fb0d6963f7d28e17f72"},
      {"message digest", "f96b697d7cb7938d525a2f31aaf161d0"},
      {"abcdefghijklmnopqrstuvwxyz", "c3fcd3d76192e4007dfb496cca67e13b"},
      {"ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789", "d174ab98d277d9f5a5611c2c9f419d9f"},
      {"12345678901234567890123456789012345678901234567890123456789012345678901234567890",
       "57edf4a22be3c955ac49da2e2107b67a"},
  };
  return rows;
}

TEST(Md5Test, PublishedSuiteWholeAndInPiecesAcrossBlockBoundaries) {
  // Pieces that split blocks at every kind of place: single bytes, pieces
  // that straddle the 64-byte boundary, and exactly one block.
  const size_t pieces[] = {0, 1, 3, 55, 56, 63, 64, 65};
  for (const Md5Row &row : Md5Suite()) {
    for (size_t piece : pieces) {
      SCOPED_TRACE("\"" + row.text + "\" in pieces of " + std::to_string(piece));
      EXPECT_EQ(Md5(row.text, piece), row.digest);
    }
  }
}

TEST(Md5Test, PaddingAtTheLengthsAroundOneBlock) {
  // Digests of runs of 'a' at the lengths where padding takes one block or
  // two, and of a million 'a' (a bit count above 2^22).
  struct Row {
    size_t length;
    const char *digest;
  };
  const Row rows[] = {
      {55, "ef1772b6dff9a122358552954ad0df65"},  {56, "3b0c8ac703f828b04c6c197006d17218"},
      {63, "b06521f39153d618550606be297466d5"},  {64, "014842d480b571495a4a0363793f7367"},
      {65, "c743a45e0d2e6a95cb859adae0248435"},  {119, "8a7bd0732ed6a28ce75f6dabc90e1613"},
      {120, "5f61c0ccad4cac44c75ff505e1f1e537"}, {1000000, "7707d6ae4e027c70eea2a935c2296f21"},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(std::to_string(row.length) + " bytes");
    const std::string text(row.length, 'a');
    EXPECT_EQ(Md5(text, 0), row.digest);
    EXPECT_EQ(Md5(text, 7), row.digest);
  }
}

TEST(Md5Test, FinalZeroesTheWholeContext) {
  nimb::Md5Context context;
  nimb::Md5Init(&context);
  nimb::Md5Update(&context, "message digest", 14);
  UINT8 digest[16];
  nimb::Md5Final(digest, &context);
  const UINT8 *bytes = reinterpret_cast<const UINT8 *>(&context);
  EXPECT_EQ(std::vector<UINT8>(bytes, bytes + sizeof(context)), std::vector<UINT8>(sizeof(context), 0));
  // Init makes it usable again.
  nimb::Md5Init(&context);
  nimb::Md5Update(&context, "abc", 3);
  nimb::Md5Final(digest, &context);
  EXPECT_EQ(Hex(digest, 16), "900150983cd24fb0d6963f7d28e17f72");
}

TEST(Md5Test, TheBitCountCarriesIntoItsHighWord) {
  struct Row {
    UINT32 low;  // bit count before the update
    UINT32 length;
    UINT32 expectedLow;
    UINT32 expectedHigh;
  };
  const Row rows[] = {
      {0xFFFFFFF8, 1, 0, 1},
      {0xFFFFFF00, 64, 0x100, 1},
      {0xFFFFFE00, 63, 0xFFFFFFF8, 0},
  };
  const std::string data(64, 'x');
  for (const Row &row : rows) {
    SCOPED_TRACE(std::to_string(row.low) + " + " + std::to_string(row.length) + " bytes");
    nimb::Md5Context context;
    nimb::Md5Init(&context);
    context.count[0] = row.low;
    nimb::Md5Update(&context, data.data(), row.length);
    EXPECT_EQ(context.count[0], row.expectedLow);
    EXPECT_EQ(context.count[1], row.expectedHigh);
  }
}

// The checksum as the definition states it, reduced after every byte, in
// its natural byte order.
UINT32 ReferenceAdler32(const std::vector<UINT8> &data) {
  UINT64 s1 = 1;
  UINT64 s2 = 0;
  for (UINT8 byte : data) {
    s1 = (s1 + byte) % 65521;
    s2 = (s2 + s1) % 65521;
  }
  return static_cast<UINT32>((s2 << 16) | s1);
}

UINT32 Reversed(UINT32 x) {
  return (x >> 24) | ((x >> 8) & 0xFF00) | ((x << 8) & 0xFF0000) | (x << 24);
}

TEST(Adler32Test, KnownValuesAreByteReversed) {
  EXPECT_EQ(nimb::Adler32("abc", 3), 0x27014D02u);
  EXPECT_EQ(nimb::Adler32("", 0), 0x01000000u);
  EXPECT_EQ(nimb::Adler32(nullptr, 0), 0x01000000u);
}

TEST(Adler32Test, LongInputsMatchTheReferenceWhateverTheChunking) {
  struct Row {
    const char *name;
    size_t length;
    UINT8 (*byte)(size_t);
  };
  const Row rows[] = {
      {"0xFF, one chunk", 5000, [](size_t) -> UINT8 { return 0xFF; }},
      {"0xFF, one byte more than a chunk", 5001, [](size_t) -> UINT8 { return 0xFF; }},
      {"0xFF, many chunks", 100003, [](size_t) -> UINT8 { return 0xFF; }},
      {"pattern, many chunks", 77777,
       [](size_t i) -> UINT8 { return static_cast<UINT8>(i * 131 + (i >> 8)); }},
      {"zeros", 20000, [](size_t) -> UINT8 { return 0; }},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(row.name);
    std::vector<UINT8> data(row.length);
    for (size_t i = 0; i < data.size(); i++)
      data[i] = row.byte(i);
    EXPECT_EQ(nimb::Adler32(data.data(), data.size()), Reversed(ReferenceAdler32(data)));
  }
}

}  // namespace
