#include "support/text.h"

#include <gtest/gtest.h>

#include <cstring>
#include <functional>
#include <string>
#include <vector>

#include "loader_fixture.h"
#include "support/sprint.h"

namespace {

using Bytes = std::vector<UINT8>;
using Units = std::vector<UINT16>;

constexpr UINT8 kGuardByte = 0xAA;
constexpr UINT16 kGuardUnit = 0xBEEF;

TEST(TextTest, UcsToUtf8RoomAndForms) {
  struct Row {
    const char *name;
    Units source;
    INT32 units;
    UINT32 size;
    UINT32 byteOrder;
    Bytes written;  // the NUL included; every byte behind it is left alone
  };
  const Row rows[] = {
      {"two and three bytes, room", {0xE9, 0x4E2D}, 2, 6, 1, {0xC3, 0xA9, 0xE4, 0xB8, 0xAD, 0}},
      {"three-byte character one short", {0xE9, 0x4E2D}, 2, 5, 1, {0xC3, 0xA9, 0}},
      {"two-byte character exact fit", {0xE9}, 1, 3, 1, {0xC3, 0xA9, 0}},
      {"nothing behind a misfit is tried", {'a', 0xE9, 'b'}, 3, 3, 1, {'a', 0}},
      {"embedded zero units dropped", {'a', 0, 0, 'b'}, 4, 8, 1, {'a', 'b', 0}},
      {"negative count", {'a'}, -1, 8, 1, {0}},
      {"size 0 writes nothing", {'a'}, 1, 0, 1, {}},
      {"form boundaries",
       {0x7F, 0x80, 0x7FF, 0x800, 0xFFFF},
       5,
       32,
       1,
       {0x7F, 0xC2, 0x80, 0xDF, 0xBF, 0xE0, 0xA0, 0x80, 0xEF, 0xBF, 0xBF, 0}},
      {"surrogates unpaired", {0xD83D, 0xDE00}, 2, 16, 1, {0xED, 0xA0, 0xBD, 0xED, 0xB8, 0x80, 0}},
      {"byte-swapped", {0xE900, 0x4100}, 2, 8, 2, {0xC3, 0xA9, 'A', 0}},
      {"native order for any other value", {0xE900}, 1, 8, 0, {0xEE, 0xA4, 0x80, 0}},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(row.name);
    // The units start at an odd address, as a device tree value may.
    Bytes unaligned(1 + 2 * row.source.size());
    std::memcpy(unaligned.data() + 1, row.source.data(), 2 * row.source.size());
    Bytes destination(row.size + 4, kGuardByte);
    nimb::UcsToUtf8(reinterpret_cast<const UINT16 *>(unaligned.data() + 1), row.units, destination.data(),
                    row.size, row.byteOrder);
    Bytes expected = row.written;
    expected.resize(destination.size(), kGuardByte);
    EXPECT_EQ(destination, expected);
  }
}

TEST(TextTest, Utf8ToUcsStopRules) {
  struct Row {
    const char *name;
    const char *source;
    UINT64 maxUnits;
    UINT64 destinationBytes;
    Units written;  // a trailing 0 is the terminator; without one, malformed
  };
  const Row rows[] = {
      {"three bytes", "\xE4\xB8\xAD", 100, 64, {0x4E2D, 0}},
      {"over-long accepted", "\xC1\x81", 100, 64, {'A', 0}},
      {"four-byte form", "a\xF0\x9F\x98\x80z", 100, 64, {'a'}},
      {"stray continuation", "a\x80z", 100, 64, {'a'}},
      {"bad second byte", "a\xC3\x41z", 100, 64, {'a'}},
      {"bad third byte", "a\xE4\xB8\xC3\xA9", 100, 64, {'a'}},
      {"unit limit", "abcd", 2, 64, {'a', 'b', 0}},
      {"limit before malformed input", "ab\x80", 2, 64, {'a', 'b', 0}},
      {"buffer one short", "abc", 100, 6, {'a', 'b', 0}},
      {"buffer for the NUL only", "ab", 100, 2, {0}},
      {"buffer too small for the NUL", "ab", 100, 1, {}},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(row.name);
    Units destination(row.destinationBytes / 2 + 4, kGuardUnit);
    UINT64 count = 12345;
    nimb::Utf8ToUcs(reinterpret_cast<const UINT8 *>(row.source), row.maxUnits, destination.data(), &count,
                    row.destinationBytes);
    EXPECT_EQ(count, row.written.size());
    Units expected = row.written;
    expected.resize(destination.size(), kGuardUnit);
    EXPECT_EQ(destination, expected);
  }
}

class TextAllocTest : public nimbtest::LoaderTest {};

TEST_F(TextAllocTest, ConversionsIntoPoolMemory) {
  const char *text = nimb::UcsToUtf8Alloc(u"a\u00E9\u4E2D\uFFFF");
  ASSERT_NE(text, nullptr);
  EXPECT_EQ(std::string(text), "a\xC3\xA9\xE4\xB8\xAD\xEF\xBF\xBF");

  struct Row {
    const char *name;
    const char *text;  // the value starts here and may go on beyond its length
    UINT64 length;
    std::u16string expected;
  };
  const Row rows[] = {
      {"multi-byte value stops at its last byte", "\xC3\xA9t\xC3\xA9 rd=x", 5, u"\u00E9t\u00E9"},
      {"character cut by the length", "ab\xC3\xA9z", 3, u"ab"},
      {"malformed input still terminated", "a\x80zz", 4, u"a"},
      {"length past the NUL", "abc", 100, u"abc"},
  };
  for (const Row &row : rows) {
    const CHAR16 *wide = nimb::Utf8ToUcsAlloc(row.text, row.length);
    ASSERT_NE(wide, nullptr) << row.name;
    EXPECT_EQ(std::u16string(wide), row.expected) << row.name;
  }

  fw.FailAllocation(1);
  EXPECT_EQ(nimb::UcsToUtf8Alloc(u"abc"), nullptr);
  fw.FailAllocation(1);
  EXPECT_EQ(nimb::Utf8ToUcsAlloc("abc", 3), nullptr);
}

using nimb::SPrint;

// One SPrint call into the row's buffer.
#define PRINT(...) [](CHAR16 *b, UINTN n) { return SPrint(b, n, __VA_ARGS__); }

TEST(SPrintTest, DirectivesAndCuts) {
  struct Row {
    const char *name;
    UINTN size;
    std::function<UINTN(CHAR16 *, UINTN)> print;
    std::u16string expected;  // the text before the terminator; size < 2 writes nothing
  };
  const Row rows[] = {
      {"hex: the low 8 digits, upper-case", 64, PRINT(u"%08x", UINT64{0x12345abcdef}), u"45ABCDEF"},
      {"cache name", 64, PRINT(u"%S.%08x", u"kernelcache", UINT64{0x27014D02}), u"kernelcache.27014D02"},
      {"narrow name, hex padded", 64, PRINT(u"%a.%08x", "cache", UINT64{0}), u"cache.00000000"},
      {"null strings", 128, PRINT(u"%S%a", nullptr, nullptr), u"<null string><null string>"},
      {"bytes widened with a zero high byte", 64, PRINT(u"%a", "\xE9x"), u"\u00E9x"},
      {"percent sign", 64, PRINT(u"100%%"), u"100%"},
      {"odd size rounds down", 11, PRINT(u"%S", u"abcdefgh"), u"abcd"},
      {"number cut", 10, PRINT(u"ab%08x", UINT64{0x12345678}), u"ab12"},
      {"literal text cut", 10, PRINT(u"abcdefgh"), u"abcd"},
      {"exact fit", 12, PRINT(u"%a", "abcde"), u"abcde"},
      {"terminator only", 2, PRINT(u"%a", "abc"), u""},
      {"later arguments in order after a cut", 14, PRINT(u"%S\\%S", u"abcd", u"efgh"), u"abcd\\e"},
      {"size 1", 1, PRINT(u"%a", "abc"), u""},
      {"size 0", 0, PRINT(u"%a", "abc"), u""},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(row.name);
    std::vector<CHAR16> buffer(row.size / 2 + 4, kGuardUnit);
    const UINTN written = row.print(buffer.data(), row.size);
    std::vector<CHAR16> expected(row.expected.begin(), row.expected.end());
    if (row.size >= 2)
      expected.push_back(0);
    EXPECT_EQ(written, expected.size());
    expected.resize(buffer.size(), kGuardUnit);
    EXPECT_EQ(buffer, expected);
  }
}

}  // namespace
