// Host tests of the platform's exact file times: the table the disk tool
// writes, the lookup and the paths that the wrapper follows.
#include "../../platform/file_times.h"

#include <gtest/gtest.h>

#include <cstring>
#include <string>
#include <vector>

namespace nimb::platform {
namespace {

struct Parsed {
  UINT32 errorLine;
  std::vector<FileTimeEntry> entries;
  std::string text;  // the buffer the entries point into
};

Parsed Parse(const std::string &source) {
  Parsed parsed{0, {}, source + '\0'};
  parsed.entries.resize(FileTimesCapacity(parsed.text.data(), source.size()));
  FileTimeTable table = {parsed.entries.data(), 0, static_cast<UINT32>(parsed.entries.size())};
  parsed.errorLine = FileTimesParse(parsed.text.data(), source.size(), &table);
  parsed.entries.resize(table.count);
  return parsed;
}

TEST(FileTimes, TableRows) {
  struct Row {
    const char *name;
    std::string text;
    UINT32 errorLine;
    UINT32 count;
  };
  const Row rows[] = {
      {"comment, blank line, CR LF", "# x\n\r\n2006-12-31 23:59:59.5 \\a\r\n", 0, 1},
      {"no fraction", "2007-01-01 00:00:00 \\System\\Library\\Extensions", 0, 1},
      {"path with a blank", "2007-01-01 00:00:00.1 \\a b\n", 0, 1},
      {"no path", "2007-01-01 00:00:00.1 \\\n", 1, 0},
      {"path not from the root", "2007-01-01 00:00:00 a\n", 1, 0},
      {"ten digits of fraction", "2007-01-01 00:00:00.1234567890 \\a\n", 1, 0},
      {"month 13", "2007-13-01 00:00:00 \\a\n", 1, 0},
      {"second 60", "2007-01-01 00:00:60 \\a\n", 1, 0},
      {"day 0", "2007-01-00 00:00:00 \\a\n", 1, 0},
      {"second line bad", "2007-01-01 00:00:00 \\a\nx\n", 2, 1},
      {"NUL inside a line", std::string("2007-01-01 00:00:00 \\a\n\0x\n", 25), 2, 1},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(row.name);
    Parsed parsed = Parse(row.text);
    EXPECT_EQ(parsed.errorLine, row.errorLine);
    EXPECT_EQ(parsed.entries.size(), row.count);
  }
}

TEST(FileTimes, FieldsAndLookup) {
  Parsed parsed = Parse(
      "2006-12-31 23:59:59.05 \\System\\Library\\Extensions\n"
      "2008-02-29 01:02:03.123456789 \\Caf\xc3\xa9\\K\n");
  ASSERT_EQ(parsed.entries.size(), 2u);
  FileTimeTable table = {parsed.entries.data(), 2, 2};
  const EFI_TIME *time = FileTimesFind(table, u"system\\LIBRARY\\Extensions");
  ASSERT_NE(time, nullptr);
  const EFI_TIME wanted = {2006, 12, 31, 23, 59, 59, 0, 50000000, 0x07FF, 0, 0};
  EXPECT_EQ(std::memcmp(time, &wanted, sizeof(wanted)), 0);
  const EFI_TIME *other = FileTimesFind(table, u"caf\u00e9\\k");
  ASSERT_NE(other, nullptr);
  EXPECT_EQ(other->Nanosecond, 123456789u);
  EXPECT_EQ(FileTimesFind(table, u"caf\u00c9\\k"), nullptr);  // only ASCII folds
  EXPECT_EQ(FileTimesFind(table, u"System\\Library"), nullptr);
  EXPECT_EQ(FileTimesFind(table, u"System\\Library\\Extensions\\x"), nullptr);
}

TEST(FileTimes, JoinRows) {
  struct Row {
    const char16_t *base;  // null: unknown
    const char16_t *name;
    const char16_t *joined;  // null: no path
  };
  const Row rows[] = {
      {u"", u"nimb_kernel", u"nimb_kernel"},
      {u"", u"\\System\\\\Library\\", u"System\\Library"},
      {u"System\\Library", u"Extensions\\A.drvb\\Info.plist",
       u"System\\Library\\Extensions\\A.drvb\\Info.plist"},
      {u"System\\Library", u"\\EFI", u"EFI"},
      {u"System\\Library", u"..\\.\\Caches", u"System\\Caches"},
      {u"System", u"..\\..\\x", u"x"},
      {u"S", u".", u"S"},
      {nullptr, u"a", nullptr},
      {nullptr, u"\\a", u"a"},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(std::u16string(row.name).size());
    CHAR16 out[kMaxTimedPath];
    const bool joined = FileTimesJoin(reinterpret_cast<const CHAR16 *>(row.base),
                                      reinterpret_cast<const CHAR16 *>(row.name), out);
    ASSERT_EQ(joined, row.joined != nullptr);
    if (joined) {
      EXPECT_EQ(std::u16string(reinterpret_cast<const char16_t *>(out)), row.joined);
    }
  }
  std::u16string longName(kMaxTimedPath, u'a');
  CHAR16 out[kMaxTimedPath];
  EXPECT_FALSE(FileTimesJoin(u"", reinterpret_cast<const CHAR16 *>(longName.c_str()), out));
}

}  // namespace
}  // namespace nimb::platform
