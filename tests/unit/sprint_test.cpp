#include "support/sprint.h"

#include <gtest/gtest.h>

#include <functional>
#include <string>
#include <vector>

namespace {

using nimb::SPrint;

constexpr CHAR16 kGuard = 0xBEEF;

TEST(SPrintTest, DirectivesAndCuts) {
  struct Row {
    const char *name;
    UINTN size;
    std::function<UINTN(CHAR16 *, UINTN)> print;
    std::u16string expected;  // the text before the terminator
  };
  const Row rows[] = {
      {"hex keeps the low 8 digits", 64,
       [](CHAR16 *b, UINTN n) { return SPrint(b, n, u"%08x", UINT64{0x123456789}); }, u"23456789"},
      {"hex pads with zeros", 64, [](CHAR16 *b, UINTN n) { return SPrint(b, n, u"%08x", UINT64{0xCD}); },
       u"000000CD"},
      {"hex digits upper-case", 64,
       [](CHAR16 *b, UINTN n) { return SPrint(b, n, u"%08x", UINT64{0xabcdef}); }, u"00ABCDEF"},
      {"cache name", 64,
       [](CHAR16 *b, UINTN n) { return SPrint(b, n, u"%S.%08x", u"kernelcache", UINT64{0x27014D02}); },
       u"kernelcache.27014D02"},
      {"narrow cache name", 64,
       [](CHAR16 *b, UINTN n) { return SPrint(b, n, u"%a.%08x", "cache", UINT64{0}); }, u"cache.00000000"},
      {"bundle path", 128,
       [](CHAR16 *b, UINTN n) {
         return SPrint(b, n, u"%S\\%S\\%SInfo.plist", u"Ext", u"A.drvb", u"Contents\\");
       },
       u"Ext\\A.drvb\\Contents\\Info.plist"},
      {"null strings", 128, [](CHAR16 *b, UINTN n) { return SPrint(b, n, u"%S%a", nullptr, nullptr); },
       u"<null string><null string>"},
      {"bytes widened with a zero high byte", 64,
       [](CHAR16 *b, UINTN n) { return SPrint(b, n, u"%a", "\xE9x"); }, u"\u00E9x"},
      {"percent sign", 64, [](CHAR16 *b, UINTN n) { return SPrint(b, n, u"100%%"); }, u"100%"},
      {"10 bytes hold 4 units", 10, [](CHAR16 *b, UINTN n) { return SPrint(b, n, u"%a", "abcdefgh"); },
       u"abcd"},
      {"odd size rounds down", 11, [](CHAR16 *b, UINTN n) { return SPrint(b, n, u"%S", u"abcdefgh"); },
       u"abcd"},
      {"number cut", 10, [](CHAR16 *b, UINTN n) { return SPrint(b, n, u"ab%08x", UINT64{0x12345678}); },
       u"ab12"},
      {"literal text cut", 10, [](CHAR16 *b, UINTN n) { return SPrint(b, n, u"abcdefgh"); }, u"abcd"},
      {"exact fit", 12, [](CHAR16 *b, UINTN n) { return SPrint(b, n, u"%a", "abcde"); }, u"abcde"},
      {"terminator only", 2, [](CHAR16 *b, UINTN n) { return SPrint(b, n, u"%a", "abc"); }, u""},
      {"later arguments in order after a cut", 14,
       [](CHAR16 *b, UINTN n) { return SPrint(b, n, u"%S\\%S", u"abcd", u"efgh"); }, u"abcd\\e"},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(row.name);
    std::vector<CHAR16> buffer(row.size / 2 + 4, kGuard);
    const UINTN written = row.print(buffer.data(), row.size);
    EXPECT_EQ(written, row.expected.size() + 1);
    std::vector<CHAR16> expected(row.expected.begin(), row.expected.end());
    expected.push_back(0);
    expected.resize(buffer.size(), kGuard);
    EXPECT_EQ(buffer, expected);
  }
}

TEST(SPrintTest, BufferTooSmallForTheTerminatorIsLeftAlone) {
  for (UINTN size : {0, 1}) {
    SCOPED_TRACE(testing::Message() << "size " << size);
    CHAR16 buffer[2] = {kGuard, kGuard};
    EXPECT_EQ(SPrint(buffer, size, u"%a", "abc"), 0u);
    EXPECT_EQ(buffer[0], kGuard);
  }
}

}  // namespace
