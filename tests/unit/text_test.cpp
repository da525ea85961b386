#include "support/text.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "boot/boot.h"
#include "hostfw/hostfw.h"
#include "memory/tracking.h"

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
      {"two-byte character one short", {0xE9}, 1, 2, 1, {0}},
      {"one byte exact fit", {'a'}, 1, 2, 1, {'a', 0}},
      {"nothing behind a misfit is tried", {'a', 0xE9, 'b'}, 3, 3, 1, {'a', 0}},
      {"terminator in the count", {'a', 'b', 0}, 3, 4, 1, {'a', 'b', 0}},
      {"embedded zero units dropped", {'a', 0, 0, 'b'}, 4, 8, 1, {'a', 'b', 0}},
      {"count stops early", {'a', 'b', 'c'}, 2, 8, 1, {'a', 'b', 0}},
      {"count of 0", {'a'}, 0, 8, 1, {0}},
      {"negative count", {'a'}, -1, 8, 1, {0}},
      {"size 1", {'a'}, 1, 1, 1, {0}},
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
    Bytes destination(row.size + 4, kGuardByte);
    nimb::UcsToUtf8(row.source.data(), row.units, destination.data(), row.size, row.byteOrder);
    Bytes expected = row.written;
    expected.resize(destination.size(), kGuardByte);
    EXPECT_EQ(destination, expected);
  }
}

TEST(TextTest, UcsToUtf8ReadsUnalignedSources) {
  const UINT8 raw[] = {0x00, 0xE9, 0x00, 'b', 0x00};  // units from byte 1
  UINT8 destination[8];
  nimb::UcsToUtf8(reinterpret_cast<const UINT16 *>(raw + 1), 2, destination, sizeof destination, 1);
  EXPECT_EQ(Bytes(destination, destination + 4), (Bytes{0xC3, 0xA9, 'b', 0}));
}

TEST(TextTest, Utf8ToUcsStopRules) {
  struct Row {
    const char *name;
    const char *source;
    UINT64 maxUnits;
    UINT64 destinationBytes;
    Units written;  // a trailing 0 is the terminator; without one, malformed
  };
  const UINT64 kRoom = 64;
  const Row rows[] = {
      {"two bytes", "\xD0\x96", 100, kRoom, {0x416, 0}},
      {"two bytes, Latin", "\xC3\xA9", 100, kRoom, {0xE9, 0}},
      {"three bytes", "\xE4\xB8\xAD", 100, kRoom, {0x4E2D, 0}},
      {"top of the range", "\xEF\xBF\xBF", 100, kRoom, {0xFFFF, 0}},
      {"over-long accepted", "\xC1\x81", 100, kRoom, {'A', 0}},
      {"ASCII", "ab", 100, kRoom, {'a', 'b', 0}},
      {"empty", "", 100, kRoom, {0}},
      {"four-byte form", "a\xF0\x9F\x98\x80z", 100, kRoom, {'a'}},
      {"stray continuation", "a\x80z", 100, kRoom, {'a'}},
      {"lead byte 0xB", "\xBF", 100, kRoom, {}},
      {"truncated two-byte", "a\xC3", 100, kRoom, {'a'}},
      {"truncated three-byte", "a\xE4\xB8", 100, kRoom, {'a'}},
      {"bad second byte", "a\xC3\x41z", 100, kRoom, {'a'}},
      {"bad third byte", "a\xE4\xB8\xC3\xA9", 100, kRoom, {'a'}},
      {"unit limit", "abcd", 2, kRoom, {'a', 'b', 0}},
      {"unit limit 0", "abcd", 0, kRoom, {0}},
      {"limit before malformed input", "ab\x80", 2, kRoom, {'a', 'b', 0}},
      {"buffer exact fit", "ab", 100, 6, {'a', 'b', 0}},
      {"buffer one short", "abc", 100, 6, {'a', 'b', 0}},
      {"odd buffer", "abcd", 100, 5, {'a', 0}},
      {"buffer for the NUL only", "ab", 100, 2, {0}},
      {"buffer too small for the NUL", "ab", 100, 1, {}},
      {"no buffer", "ab", 100, 0, {}},
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

class TextAllocTest : public ::testing::Test {
 protected:
  void SetUp() override {
    nimb::gST = fw_.SystemTable();
    nimb::gBS = fw_.BootServices();
    nimb::gRT = fw_.RuntimeServices();
  }
  void TearDown() override { nimb::TrackedFreeAll(); }

  hostfw::Firmware fw_;
};

TEST_F(TextAllocTest, UcsToUtf8Alloc) {
  const char *text = nimb::UcsToUtf8Alloc(u"a\u00E9\u4E2D\uFFFF");
  ASSERT_NE(text, nullptr);
  EXPECT_EQ(std::string(text), "a\xC3\xA9\xE4\xB8\xAD\xEF\xBF\xBF");

  const char *empty = nimb::UcsToUtf8Alloc(u"");
  ASSERT_NE(empty, nullptr);
  EXPECT_EQ(std::string(empty), "");

  fw_.FailAllocation(1);
  EXPECT_EQ(nimb::UcsToUtf8Alloc(u"abc"), nullptr);
}

TEST_F(TextAllocTest, Utf8ToUcsAllocStaysInsideTheValue) {
  struct Row {
    const char *name;
    const char *text;  // the value starts here and may go on beyond its length
    UINT64 length;
    std::u16string expected;
  };
  const Row rows[] = {
      {"value inside a longer string", "nimb_kernel rd=disk0", 11, u"nimb_kernel"},
      {"multi-byte value stops at its last byte", "\xC3\xA9t\xC3\xA9 rd=x", 5, u"\u00E9t\u00E9"},
      {"three-byte value", "\xE4\xB8\xAD\xE4\xB8\xAD", 3, u"\u4E2D"},
      {"character cut by the length", "ab\xC3\xA9z", 3, u"ab"},
      {"malformed input still terminated", "a\x80zz", 4, u"a"},
      {"four-byte form still terminated", "\xF0\x9F\x98\x80", 4, u""},
      {"length past the NUL", "abc", 100, u"abc"},
      {"length 0", "abc", 0, u""},
      {"empty", "", 5, u""},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(row.name);
    const CHAR16 *text = nimb::Utf8ToUcsAlloc(row.text, row.length);
    ASSERT_NE(text, nullptr);
    EXPECT_EQ(std::u16string(text), row.expected);
  }

  fw_.FailAllocation(1);
  EXPECT_EQ(nimb::Utf8ToUcsAlloc("abc", 3), nullptr);
}

}  // namespace
