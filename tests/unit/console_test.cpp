// The formatter, the console's character output and modes, and Fatal.
#include "screen/console.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <string>
#include <tuple>
#include <vector>

#include "loader_fixture.h"

namespace {

using nimbtest::LoaderTest;

struct FormatRow {
  const char *format;
  uint64_t a;
  uint64_t b;
  const char *expected;
};

const char kAb[] = "ab";
const char16_t kWide[] = u"h\u0100i";
const char16_t kWideHigh[] = u"\u4142z";

uint64_t Ptr(const void *p) {
  return reinterpret_cast<uint64_t>(p);
}

TEST(FormatEngine, Directives) {
  const FormatRow rows[] = {
      {"%d", 1234567890, 0, "1234567890"},
      {"%x", 0xABC, 0, "abc"},
      {"%X", 0xABC, 0, "ABC"},
      {"%o", 8, 0, "10"},
      {"%08x", 0x1FF, 0, "000001ff"},
      {"%05d", static_cast<uint64_t>(-42), 0, "-0042"},
      {"%5d", static_cast<uint64_t>(-42), 0, "-  42"},
      {"%d", 0x80000000, 0, "-2147483648"},
      // 64-bit values: the sign is the low half's bit 31.
      {"%ld", 0x100000000ULL, 0, "4294967296"},
      {"%ld", 0x1FFFFFFFFULL, 0, "-1"},
      {"%lx", 0x123456789ULL, 0, "123456789"},
      {"%x", 0x123456789ULL, 0, "23456789"},
      {"%lo", 0xFFFFFFFFFFFFFFFFULL, 0, "1777777777777777777777"},
      {"%p", 255, 0, "0xff"},
      {"%8p", 255, 0, "0x      ff"},
      {"%p", 0xFFFFFFFF00000000ULL, 0, "0xffffffff00000000"},
      {"%c", 65, 0, "A"},
      {"%5s", Ptr(kAb), 0, "ab   "},
      {"%s", 0, 0, "<null string>"},
      {"[%S]", Ptr(kWide), 0, "[h]"},
      {"%S", Ptr(kWideHigh), 0, "Bz"},
      {"%l5x", 0x1F, 0, "   1f"},
      {"%0 8x", 0x1F, 0, "0000001f"},
      // Unknown directives are swallowed and take no argument.
      {"a%ub%%c", 0, 0, "abc"},
      {"%u%d", 7, 0, "7"},
      {"%i|%d", 3, 0, "|3"},
      // A NUL behind a % ends the format.
      {"ab%", 0, 0, "ab"},
      {"%d-%d", 1, 2, "1-2"},
  };
  for (const FormatRow &row : rows) {
    char buffer[128];
    memset(buffer, 0x55, sizeof(buffer));
    EXPECT_EQ(nimb::sprintf(buffer, row.format, row.a, row.b), 0);
    EXPECT_STREQ(buffer, row.expected) << "format \"" << row.format << "\"";
  }
}

void Collect(int32_t c, void *context) {
  static_cast<std::vector<int32_t> *>(context)->push_back(c);
}

std::vector<int32_t> FormatToCodes(const char *format, ...) {
  std::vector<int32_t> codes;
  va_list args;
  va_start(args, format);
  nimb::FormatEngine(format, Collect, &codes, args);
  va_end(args);
  return codes;
}

TEST(FormatEngine, EightBitCharactersArriveSignExtended) {
  EXPECT_EQ(FormatToCodes("\xE9"), std::vector<int32_t>({-23}));
  static const char high[] = "\x80\xFF";
  EXPECT_EQ(FormatToCodes("%s", high), std::vector<int32_t>({-128, -1}));
  // %c hands its 32-bit argument over unchanged.
  EXPECT_EQ(FormatToCodes("%c", uint64_t{0x1E9}), std::vector<int32_t>({0x1E9}));
}

class ConsoleTest : public LoaderTest {};

TEST_F(ConsoleTest, CharactersReachTheFirmwareOneUnitAtATime) {
  nimb::printf("a\tb\n\r\xE9");
  std::vector<std::u16string> expected = {u"a"};
  expected.insert(expected.end(), 8, u" ");
  expected.insert(expected.end(), {u"b", u"\r", u"\n", u"\r", std::u16string(1, char16_t(0xFFE9))});
  EXPECT_EQ(fw.ConOutCalls(), expected);

  // Without ConOut to StdErr; without either, nowhere.
  fw.SetConOutPresent(false);
  Attach();
  nimb::ErrorPrintf("x\n");
  EXPECT_EQ(fw.StdErrCalls(), (std::vector<std::u16string>{u"x", u"\r", u"\n"}));
  fw.SetStdErrPresent(false);
  Attach();
  nimb::printf("dropped");
  EXPECT_EQ(fw.StdErrCalls().size(), 3u);
}

TEST_F(ConsoleTest, InitConsoleFailuresAndModeChanges) {
  for (const char *failing : {"", "LocateProtocol", "GetMode"}) {
    hostfw::Firmware local;
    local.SetConsoleControlPresent(*failing != '\0');
    if (*failing != '\0')
      local.FailCall(failing);
    nimbtest::AttachTo(local);
    EXPECT_TRUE(EFI_ERROR(nimb::InitConsole())) << failing;
    EXPECT_EQ(nimb::gConsoleMode + nimb::gInitialConsoleMode, 0u) << failing;
  }
  // Modes change only when they differ.
  nimbtest::AttachTo(fw);
  fw.SetConsoleMode(EfiConsoleControlScreenText);
  ASSERT_EQ(nimb::InitConsole(), EFI_SUCCESS);
  EXPECT_EQ(nimb::SetConsoleMode(nimb::kConsoleGraphics), EFI_SUCCESS);
  EXPECT_EQ(nimb::SetConsoleMode(nimb::kConsoleGraphics), EFI_SUCCESS);
  EXPECT_EQ(nimb::SetConsoleMode(3), EFI_INVALID_PARAMETER);
  EXPECT_EQ(std::count_if(fw.ConsoleModeCalls().begin(), fw.ConsoleModeCalls().end(),
                          [](const hostfw::ConsoleModeCall &call) { return call.set; }),
            1);
  EXPECT_EQ(nimb::gConsoleMode, 1u);
  // A refused change leaves the recorded mode telling the truth.
  fw.FailCall("SetMode");
  EXPECT_TRUE(EFI_ERROR(nimb::SetConsoleMode(nimb::kConsoleText)));
  EXPECT_EQ(nimb::gConsoleMode, 1u);
}

TEST_F(ConsoleTest, FatalPrintsRestoresTheConsoleAndGivesEverythingBack) {
  fw.SetConsoleMode(EfiConsoleControlScreenText);
  hostfw::RunResult result = fw.Call([] {
    ASSERT_EQ(nimb::InitConsole(), EFI_SUCCESS);
    ASSERT_EQ(nimb::SetConsoleMode(nimb::kConsoleGraphics), EFI_SUCCESS);
    EFI_PHYSICAL_ADDRESS pages = 0;
    ASSERT_EQ(nimb::TrackedAllocatePages(AllocateAnyPages, EfiLoaderData, 3, &pages), EFI_SUCCESS);
    for (int i = 0; i < 200; i++)
      ASSERT_NE(nimb::TrackedAllocatePool(24), nullptr);
    nimb::Fatal("Bad %s at %x", "thing", 0x10u);
  });
  // No newline is added to a fatal message.
  EXPECT_EQ(std::make_tuple(result.end, result.status, fw.ConOutText(), fw.ConsoleMode(), nimb::gConsoleMode,
                            nimb::gMemoryTags == nullptr),
            std::make_tuple(hostfw::RunEnd::Exited, EFI_ABORTED, std::string("Bad thing at 10"),
                            EfiConsoleControlScreenText, UINT32{0}, true));
  ExpectNothingHeld();
}

}  // namespace
