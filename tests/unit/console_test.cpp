// The formatter, the console's character output and modes, and Fatal.
#include "screen/console.h"

#include <gtest/gtest.h>

#include <cstring>
#include <string>
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
      {"%d", 0, 0, "0"},
      {"%d", 1234567890, 0, "1234567890"},
      {"%x", 0xABC, 0, "abc"},
      {"%X", 0xABC, 0, "ABC"},
      {"%o", 8, 0, "10"},
      {"%O", 64, 0, "100"},
      {"%02x", 0x1FF, 0, "1ff"},
      {"%08x", 0x1FF, 0, "000001ff"},
      {"%05d", static_cast<uint64_t>(-42), 0, "-0042"},
      {"%5d", static_cast<uint64_t>(-42), 0, "-  42"},
      {"%d", 0xFFFFFFFF, 0, "-1"},
      {"%d", 0x80000000, 0, "-2147483648"},
      // 64-bit values: the sign is the low half's bit 31.
      {"%ld", 0x100000000ULL, 0, "4294967296"},
      {"%ld", 0x1FFFFFFFFULL, 0, "-1"},
      {"%lx", 0x123456789ULL, 0, "123456789"},
      {"%qx", 0x123456789ULL, 0, "123456789"},
      {"%x", 0x123456789ULL, 0, "23456789"},
      {"%lo", 0xFFFFFFFFFFFFFFFFULL, 0, "1777777777777777777777"},
      {"%p", 255, 0, "0xff"},
      {"%P", 255, 0, "0xFF"},
      {"%8p", 255, 0, "0x      ff"},
      {"%p", 0xFFFFFFFF00000000ULL, 0, "0xffffffff00000000"},
      {"%c", 65, 0, "A"},
      {"%3c", 65, 0, "A"},
      {"%5s", Ptr(kAb), 0, "ab   "},
      {"%1s", Ptr(kAb), 0, "ab"},
      {"%s", 0, 0, "<null string>"},
      {"[%S]", Ptr(kWide), 0, "[h]"},
      {"[%4S]", Ptr(kWide), 0, "[h   ]"},
      {"%S", Ptr(kWideHigh), 0, "Bz"},
      {"% d", 5, 0, "5"},
      {"%l5x", 0x1F, 0, "   1f"},
      {"%0 8x", 0x1F, 0, "0000001f"},
      // Unknown directives are swallowed and take no argument.
      {"a%ub%%c", 0, 0, "abc"},
      {"%u%d", 7, 0, "7"},
      {"%hd", 7, 0, "d"},
      {"%i|%d", 3, 0, "|3"},
      // A NUL behind a % ends the format.
      {"ab%", 0, 0, "ab"},
      {"ab%08", 0, 0, "ab"},
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

TEST(FormatNumber, PadsAfterTheSign) {
  std::vector<int32_t> codes;
  nimb::FormatNumber(0xFFFFFFD6, 10, nimb::kFormatZeroPad, 6, Collect, &codes);
  EXPECT_EQ(std::string(codes.begin(), codes.end()), "-00042");
  codes.clear();
  nimb::FormatNumber(0, 16, 0, 0, Collect, &codes);
  EXPECT_EQ(std::string(codes.begin(), codes.end()), "0");
}

class ConsoleTest : public LoaderTest {};

TEST_F(ConsoleTest, CharactersReachTheFirmwareOneUnitAtATime) {
  nimb::printf("a\tb\n");
  std::vector<std::u16string> expected = {u"a"};
  for (int i = 0; i < 8; i++)
    expected.push_back(u" ");
  expected.insert(expected.end(), {u"b", u"\r", u"\n"});
  EXPECT_EQ(fw.ConOutCalls(), expected);

  // A carriage return stays alone; a high byte arrives sign-extended.
  nimb::printf("\r\xE9");
  ASSERT_EQ(fw.ConOutCalls().size(), 14u);
  EXPECT_EQ(fw.ConOutCalls()[12], u"\r");
  EXPECT_EQ(fw.ConOutCalls()[13], std::u16string(1, char16_t(0xFFE9)));
}

TEST_F(ConsoleTest, OutputFallsBackToStdErrAndIsDroppedWithoutEither) {
  fw.SetConOutPresent(false);
  Attach();
  nimb::printf("x\n");
  EXPECT_TRUE(fw.ConOutCalls().empty());
  EXPECT_EQ(fw.StdErrCalls(), (std::vector<std::u16string>{u"x", u"\r", u"\n"}));

  fw.SetStdErrPresent(false);
  Attach();
  nimb::printf("dropped");
  nimb::ErrorPrintf("dropped");
  EXPECT_EQ(fw.StdErrCalls().size(), 3u);
}

TEST_F(ConsoleTest, InitConsoleNotesTheModeItFinds) {
  fw.SetConsoleMode(EfiConsoleControlScreenGraphics);
  ASSERT_EQ(nimb::InitConsole(), EFI_SUCCESS);
  EXPECT_EQ(nimb::gConsoleMode, 1u);
  EXPECT_EQ(nimb::gInitialConsoleMode, 1u);
}

TEST_F(ConsoleTest, InitConsoleFailures) {
  struct Row {
    const char *name;
    bool present;
    const char *failingCall;
  } rows[] = {
      {"no protocol", false, nullptr},
      {"LocateProtocol fails", true, "LocateProtocol"},
      {"GetMode fails", true, "GetMode"},
  };
  for (const Row &row : rows) {
    hostfw::Firmware local;
    local.SetConsoleControlPresent(row.present);
    if (row.failingCall != nullptr)
      local.FailCall(row.failingCall);
    nimbtest::ResetLoaderState();
    nimb::gST = local.SystemTable();
    nimb::gBS = local.BootServices();
    EXPECT_TRUE(EFI_ERROR(nimb::InitConsole())) << row.name;
    EXPECT_EQ(nimb::gConsoleMode, nimb::gInitialConsoleMode) << row.name;
  }
  nimbtest::ResetLoaderState();
  Attach();
}

TEST_F(ConsoleTest, SetConsoleModeCallsTheFirmwareOnlyForAChange) {
  fw.SetConsoleMode(EfiConsoleControlScreenText);
  ASSERT_EQ(nimb::InitConsole(), EFI_SUCCESS);
  size_t base = fw.ConsoleModeCalls().size();
  auto setCalls = [&] {
    size_t n = 0;
    for (size_t i = base; i < fw.ConsoleModeCalls().size(); i++)
      n += fw.ConsoleModeCalls()[i].set;
    return n;
  };

  EXPECT_EQ(nimb::SetConsoleMode(nimb::kConsoleGraphics), EFI_SUCCESS);
  EXPECT_EQ(nimb::SetConsoleMode(nimb::kConsoleGraphics), EFI_SUCCESS);
  EXPECT_EQ(setCalls(), 1u);
  EXPECT_EQ(fw.ConsoleMode(), EfiConsoleControlScreenGraphics);

  EXPECT_EQ(nimb::SetConsoleMode(0), EFI_INVALID_PARAMETER);
  EXPECT_EQ(nimb::SetConsoleMode(3), EFI_INVALID_PARAMETER);
  EXPECT_EQ(setCalls(), 1u);

  // A refused change leaves the recorded mode telling the truth.
  fw.FailCall("SetMode");
  EXPECT_TRUE(EFI_ERROR(nimb::SetConsoleMode(nimb::kConsoleText)));
  EXPECT_EQ(nimb::gConsoleMode, 1u);

  EXPECT_EQ(nimb::RestoreConsoleMode(), EFI_SUCCESS);
  EXPECT_EQ(nimb::gConsoleMode, 0u);
  EXPECT_EQ(fw.ConsoleMode(), EfiConsoleControlScreenText);
  size_t calls = fw.ConsoleModeCalls().size();
  EXPECT_EQ(nimb::RestoreConsoleMode(), EFI_SUCCESS);
  EXPECT_EQ(fw.ConsoleModeCalls().size(), calls);
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
  EXPECT_EQ(result.end, hostfw::RunEnd::Exited);
  EXPECT_EQ(result.status, EFI_ABORTED);
  // No newline is added to a fatal message.
  EXPECT_EQ(fw.ConOutText(), "Bad thing at 10");
  EXPECT_EQ(fw.ConsoleMode(), EfiConsoleControlScreenText);
  EXPECT_EQ(nimb::gConsoleMode, 0u);
  ExpectNothingHeld();
  EXPECT_EQ(nimb::gMemoryTags, nullptr);
}

}  // namespace
