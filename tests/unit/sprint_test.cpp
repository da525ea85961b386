#include "support/sprint.h"

#include <gtest/gtest.h>

#include <functional>
#include <string>
#include <vector>

namespace {

using nimb::SPrint;

constexpr CHAR16 kGuard = 0xBEEF;

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
    std::vector<CHAR16> buffer(row.size / 2 + 4, kGuard);
    const UINTN written = row.print(buffer.data(), row.size);
    std::vector<CHAR16> expected(row.expected.begin(), row.expected.end());
    if (row.size >= 2)
      expected.push_back(0);
    EXPECT_EQ(written, expected.size());
    expected.resize(buffer.size(), kGuard);
    EXPECT_EQ(buffer, expected);
  }
}

}  // namespace
