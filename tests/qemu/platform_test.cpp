// Host tests of the platform layer's logic: its configuration file, text
// conversion, report formatting, exit codes, memory count and console modes.
#include <gtest/gtest.h>

#include <cstdarg>
#include <cstring>
#include <string>
#include <vector>

#include "../../platform/config.h"
#include "../../platform/console_control.h"
#include "../../platform/exitcodes.h"
#include "../../platform/format.h"
#include "../../platform/memory.h"

namespace nimb::platform {
namespace {

// --- configuration file ------------------------------------------------------------

struct Issue {
  ConfigProblem problem;
  UINT32 line;
  std::string key;
  bool operator==(const Issue &other) const {
    return problem == other.problem && line == other.line && key == other.key;
  }
};

void CollectIssue(const ConfigIssue &issue, void *context) {
  static_cast<std::vector<Issue> *>(context)->push_back({issue.problem, issue.line, issue.key});
}

struct ConfigRow {
  const char *name;
  std::string text;
  const char *loader;
  const char *options;  // null: none given
  EFI_CONSOLE_CONTROL_SCREEN_MODE console;
  UINT32 hold;
  UINT32 errors;
  std::vector<Issue> issues;
};

constexpr auto kText = EfiConsoleControlScreenText;
constexpr auto kGraphics = EfiConsoleControlScreenGraphics;
const char *const kDefault = kDefaultLoaderPath;

TEST(PlatformConfig, ParsesLinesKeysAndValues) {
  const std::vector<ConfigRow> rows = {
      {"empty file", "", kDefault, nullptr, kGraphics, 0, 0, {}},
      {"all keys", "loader=\\a.efi\noptions=-v\nconsole=text\nhold=3\n", "\\a.efi", "-v", kText, 3, 0, {}},
      {"comments, blank lines, CR LF, no final newline",
       "# comment\r\n\r\n  # indented comment\r\n\thold = 12 \r\nconsole=graphics",
       kDefault,
       nullptr,
       kGraphics,
       12,
       0,
       {}},
      {"value keeps inner blanks and later '='",
       "options= a=b  c \n",
       kDefault,
       "a=b  c",
       kGraphics,
       0,
       0,
       {}},
      {"empty options are options", "options=\n", kDefault, "", kGraphics, 0, 0, {}},
      {"quotes keep blanks and resolve escapes",
       "options=\"  \\t-v\\n\\\"q\\\"\\\\ \"\n",
       kDefault,
       "  \t-v\n\"q\"\\ ",
       kGraphics,
       0,
       0,
       {}},
      {"later key wins", "hold=1\nhold=2\n", kDefault, nullptr, kGraphics, 2, 0, {}},
      {"unknown key is reported, not an error",
       "colour=blue\nhold=1\n",
       kDefault,
       nullptr,
       kGraphics,
       1,
       0,
       {{kConfigUnknownKey, 1, "colour"}}},
      {"keys are case-sensitive",
       "Hold=1\n",
       kDefault,
       nullptr,
       kGraphics,
       0,
       0,
       {{kConfigUnknownKey, 1, "Hold"}}},
      {"line without '='",
       "hold 3\nconsole=text\n",
       kDefault,
       nullptr,
       kText,
       0,
       1,
       {{kConfigNoEquals, 1, "hold 3"}}},
      {"bad console", "console=vga\n", kDefault, nullptr, kGraphics, 0, 1, {{kConfigBadValue, 1, "console"}}},
      {"hold not a number",
       "\nhold=3s\n",
       kDefault,
       nullptr,
       kGraphics,
       0,
       1,
       {{kConfigBadValue, 2, "hold"}}},
      {"hold negative", "hold=-1\n", kDefault, nullptr, kGraphics, 0, 1, {{kConfigBadValue, 1, "hold"}}},
      {"hold too long", "hold=3601\n", kDefault, nullptr, kGraphics, 0, 1, {{kConfigBadValue, 1, "hold"}}},
      {"hold at its limit", "hold=3600\n", kDefault, nullptr, kGraphics, 3600, 0, {}},
      {"empty loader", "loader=\n", kDefault, nullptr, kGraphics, 0, 1, {{kConfigBadValue, 1, "loader"}}},
      {"unterminated quote",
       "options=\"-v\n",
       kDefault,
       nullptr,
       kGraphics,
       0,
       1,
       {{kConfigBadValue, 1, "options"}}},
      {"quote inside quotes",
       "options=\"a\"b\"\n",
       kDefault,
       nullptr,
       kGraphics,
       0,
       1,
       {{kConfigBadValue, 1, "options"}}},
      {"escaped closing quote",
       "options=\"a\\\"\n",
       kDefault,
       nullptr,
       kGraphics,
       0,
       1,
       {{kConfigBadValue, 1, "options"}}},
      {"unknown escape",
       "options=\"\\q\"\n",
       kDefault,
       nullptr,
       kGraphics,
       0,
       1,
       {{kConfigBadValue, 1, "options"}}},
      {"options beyond UCS-2",
       "options=\xF0\x9F\x98\x80\n",
       kDefault,
       nullptr,
       kGraphics,
       0,
       1,
       {{kConfigBadValue, 1, "options"}}},
      {"errors are counted, parsing goes on",
       "x\ny\nhold=2\n",
       kDefault,
       nullptr,
       kGraphics,
       2,
       2,
       {{kConfigNoEquals, 1, "x"}, {kConfigNoEquals, 2, "y"}}},
      {"NUL ends a line",
       std::string("hold=1\0junk\nconsole=text", 24),
       kDefault,
       nullptr,
       kText,
       1,
       1,
       {{kConfigNoEquals, 2, "junk"}}},
  };
  for (const ConfigRow &row : rows) {
    SCOPED_TRACE(row.name);
    std::vector<char> text(row.text.begin(), row.text.end());
    text.push_back('\x7f');  // the byte behind the text, which the parser may overwrite
    PlatformConfig config;
    ConfigSetDefaults(&config);
    std::vector<Issue> issues;
    EXPECT_EQ(ConfigParse(text.data(), row.text.size(), &config, CollectIssue, &issues), row.errors);
    EXPECT_STREQ(config.loaderPath, row.loader);
    if (row.options == nullptr) {
      EXPECT_EQ(config.options, nullptr);
    } else {
      EXPECT_STREQ(config.options, row.options);
    }
    EXPECT_EQ(config.consoleMode, row.console);
    EXPECT_EQ(config.holdSeconds, row.hold);
    EXPECT_EQ(issues, row.issues);
  }
}

// --- UTF-8 to UCS-2 -----------------------------------------------------------------

TEST(PlatformConfig, ConvertsUtf8ToUcs2) {
  struct Row {
    const char *name;
    const char *text;
    size_t capacity;  // units, the NUL counted
    bool valid;       // well-formed and within U+FFFF
    bool fits;
    std::u16string wide;
  };
  const std::vector<Row> rows = {
      {"ASCII", "\\EFI\\a", 16, true, true, u"\\EFI\\a"},
      {"empty", "", 1, true, true, u""},
      {"two and three bytes", "\xC3\xA9-\xE2\x82\xAC", 16, true, true, u"\u00E9-\u20AC"},
      {"highest of the plane", "\xEF\xBF\xBF", 2, true, true, u"\uFFFF"},
      {"exactly fits", "abc", 4, true, true, u"abc"},
      {"one unit short", "abc", 3, true, false, u""},
      {"no room at all", "", 0, true, false, u""},
      {"four bytes", "\xF0\x9F\x98\x80", 16, false, false, u""},
      {"overlong slash", "\xC0\xAF", 16, false, false, u""},
      {"overlong three bytes", "\xE0\x80\xAF", 16, false, false, u""},
      {"surrogate", "\xED\xA0\x80", 16, false, false, u""},
      {"stray continuation", "a\x80", 16, false, false, u""},
      {"cut short", "a\xE2\x82", 16, false, false, u""},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(row.name);
    UINTN counted = 99;
    ASSERT_EQ(Utf8ToUcs2(row.text, nullptr, 0, &counted), row.valid);
    std::vector<CHAR16> buffer(row.capacity + 1, 0x7777);
    UINTN units = 99;
    ASSERT_EQ(Utf8ToUcs2(row.text, buffer.data(), row.capacity, &units), row.fits);
    EXPECT_EQ(buffer[row.capacity], 0x7777) << "wrote past the capacity";
    if (row.fits) {
      EXPECT_EQ(units, row.wide.size());
      EXPECT_EQ(counted, row.wide.size());
      EXPECT_EQ(std::u16string(buffer.data(), units + 1), row.wide + u'\0');
    }
  }
}

// --- report formatting and exit codes --------------------------------------------

void AppendTo(char character, void *context) {
  static_cast<std::string *>(context)->push_back(character);
}

std::string Formatted(const char *format, ...) {
  std::string text;
  va_list arguments;
  va_start(arguments, format);
  FormatText(AppendTo, &text, format, arguments);
  va_end(arguments);
  return text;
}

TEST(PlatformFormat, FormatsDirectives) {
  struct Row {
    const char *name;
    std::string text;
    const char *expected;
  };
  const std::vector<Row> rows = {
      {"string and decimal", Formatted("[%s] %u", "a b", UINT64{0}), "[a b] 0"},
      {"64-bit hexadecimal", Formatted("0x%x", EFI_ABORTED), "0x8000000000000015"},
      {"largest decimal", Formatted("%u", ~UINT64{0}), "18446744073709551615"},
      {"character and percent", Formatted("%c%%", 'A'), "A%"},
      {"unknown directive as it stands", Formatted("%q%u", UINT64{7}), "%q7"},
      {"null string", Formatted("%s", static_cast<const char *>(nullptr)), "(null)"},
      {"lone percent at the end", Formatted("50%"), "50%"},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(row.name);
    EXPECT_EQ(row.text, row.expected);
  }
  char small[8];
  EXPECT_EQ(FormatToBuffer(small, sizeof(small), "%s=%u", "memory", UINT64{123}), 10u);
  EXPECT_STREQ(small, "memory=");
  EXPECT_STREQ(StatusName(EFI_ABORTED), "EFI_ABORTED");
  EXPECT_STREQ(StatusName(EFIERR(99)), "unknown status");
}

TEST(PlatformExitCodes, TellOutcomesApart) {
  struct Row {
    EFI_STATUS status;
    bool changed;
    UINT8 code;
  };
  const std::vector<Row> rows = {
      {EFI_ABORTED, false, kExitAbortedSame},
      {EFI_ABORTED, true, kExitAbortedChanged},
      {EFI_SUCCESS, false, kExitSuccessSame},
      {EFI_SUCCESS, true, kExitSuccessChanged},
      {EFI_NOT_FOUND, false, kExitOtherSame},
      {EFI_LOAD_ERROR, true, kExitOtherChanged},
      {1, false, kExitOtherSame},  // a warning is neither success nor EFI_ABORTED
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(StatusName(row.status));
    EXPECT_EQ(ExitCodeForOutcome(row.status, row.changed), row.code);
  }
  // QEMU's exit status is (code << 1) | 1 and must stay below 256.
  for (const UINT8 code : {kExitAbortedSame, kExitAbortedChanged, kExitSuccessSame, kExitSuccessChanged,
                           kExitOtherSame, kExitOtherChanged, kExitConfigInvalid, kExitLoaderMissing,
                           kExitLoadImageFailed, kExitPlatformFailed}) {
    EXPECT_LT(code, 0x80);
  }
}

// --- memory count ----------------------------------------------------------------------

TEST(PlatformMemory, CountsConventionalPagesByTheFirmwaresStride) {
  struct Row {
    const char *name;
    UINTN stride;
    UINTN extraBytes;  // a cut-off descriptor at the end
  };
  const std::vector<Row> rows = {
      {"stride of the structure", sizeof(EFI_MEMORY_DESCRIPTOR), 0},
      {"wider stride", 0x30, 0},
      {"cut-off tail ignored", 0x30, 0x20},
  };
  const std::vector<std::pair<UINT32, UINT64>> regions = {
      {EfiConventionalMemory, 100}, {EfiBootServicesData, 7},   {EfiConventionalMemory, 23},
      {EfiLoaderData, 5},           {EfiConventionalMemory, 1},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(row.name);
    std::vector<UINT8> map(regions.size() * row.stride + row.extraBytes, 0xEE);
    for (size_t i = 0; i < regions.size(); i++) {
      EFI_MEMORY_DESCRIPTOR descriptor = {};
      descriptor.Type = regions[i].first;
      descriptor.NumberOfPages = regions[i].second;
      std::memcpy(&map[i * row.stride], &descriptor, sizeof(descriptor));
    }
    if (row.extraBytes != 0) {
      EFI_MEMORY_DESCRIPTOR tail = {};
      tail.Type = EfiConventionalMemory;
      tail.NumberOfPages = 1000;
      std::memcpy(&map[regions.size() * row.stride], &tail, row.extraBytes);
    }
    EXPECT_EQ(CountConventionalPages(map.data(), map.size(), row.stride), 124u);
  }
  EXPECT_EQ(CountConventionalPages(nullptr, 0, 0x30), 0u);
}

// --- console control -------------------------------------------------------------------

// Text output and graphics output that record what is done to the screen.
struct Screen {
  std::vector<std::string> calls;
  EFI_STATUS clearStatus = EFI_SUCCESS;
};
Screen *gScreen;

EFI_STATUS EFIAPI FakeClearScreen(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *) {
  gScreen->calls.push_back("clear");
  return gScreen->clearStatus;
}

EFI_STATUS EFIAPI FakeEnableCursor(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *, BOOLEAN visible) {
  gScreen->calls.push_back(visible ? "cursor on" : "cursor off");
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI FakeBlt(EFI_GRAPHICS_OUTPUT_PROTOCOL *, EFI_GRAPHICS_OUTPUT_BLT_PIXEL *pixel,
                          EFI_GRAPHICS_OUTPUT_BLT_OPERATION operation, UINTN, UINTN, UINTN x, UINTN y,
                          UINTN width, UINTN height, UINTN) {
  const bool black = pixel->Red == 0 && pixel->Green == 0 && pixel->Blue == 0;
  gScreen->calls.push_back("blt " + std::to_string(operation) + (black ? " black " : " colour ") +
                           std::to_string(x) + "," + std::to_string(y) + " " + std::to_string(width) + "x" +
                           std::to_string(height));
  return EFI_SUCCESS;
}

struct Firmware {
  Screen screen;
  EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL text = {};
  EFI_GRAPHICS_OUTPUT_MODE_INFORMATION info = {};
  EFI_GRAPHICS_OUTPUT_PROTOCOL_MODE mode = {};
  EFI_GRAPHICS_OUTPUT_PROTOCOL graphics = {};
  Firmware() {
    gScreen = &screen;
    text.ClearScreen = FakeClearScreen;
    text.EnableCursor = FakeEnableCursor;
    info.HorizontalResolution = 1280;
    info.VerticalResolution = 800;
    mode.Info = &info;
    graphics.Blt = FakeBlt;
    graphics.Mode = &mode;
  }
};

const std::string kGraphicsEntry[] = {"cursor off", "blt 0 black 0,0 1280x800"};

TEST(PlatformConsole, SwitchesModesOnTheRealConsole) {
  using Calls = std::vector<std::string>;
  struct Row {
    const char *name;
    EFI_CONSOLE_CONTROL_SCREEN_MODE start;
    UINT32 wanted;
    EFI_STATUS status;
    EFI_CONSOLE_CONTROL_SCREEN_MODE after;
    Calls calls;  // of SetMode only
  };
  const std::vector<Row> rows = {
      {"text to graphics", kText, kGraphics, EFI_SUCCESS, kGraphics, {kGraphicsEntry[0], kGraphicsEntry[1]}},
      {"graphics to text", kGraphics, kText, EFI_SUCCESS, kText, {"clear", "cursor on"}},
      {"text to text", kText, kText, EFI_SUCCESS, kText, {}},
      {"graphics to graphics", kGraphics, kGraphics, EFI_SUCCESS, kGraphics, {}},
      {"beyond the modes", kText, 2, EFI_INVALID_PARAMETER, kText, {}},
      {"far beyond", kGraphics, 0xFFFFFFFF, EFI_INVALID_PARAMETER, kGraphics, {}},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(row.name);
    Firmware firmware;
    PlatformConsole console;
    ASSERT_EQ(ConsoleControlInit(&console, &firmware.text, &firmware.graphics, row.start), EFI_SUCCESS);
    firmware.screen.calls.clear();
    EXPECT_EQ(
        console.protocol.SetMode(&console.protocol, static_cast<EFI_CONSOLE_CONTROL_SCREEN_MODE>(row.wanted)),
        row.status);
    EXPECT_EQ(firmware.screen.calls, row.calls);
    EFI_CONSOLE_CONTROL_SCREEN_MODE mode = EfiConsoleControlScreenMaxValue;
    BOOLEAN uga = 7;
    BOOLEAN locked = 7;
    ASSERT_EQ(console.protocol.GetMode(&console.protocol, &mode, &uga, &locked), EFI_SUCCESS);
    EXPECT_EQ(mode, row.after);
    EXPECT_EQ(uga, TRUE);
    EXPECT_EQ(locked, FALSE);
  }
}

TEST(PlatformConsole, StartsCleanAndCopesWithoutGraphics) {
  Firmware firmware;
  PlatformConsole console;
  // The starting mode is entered even when it is the default, so the screen
  // starts clean.
  ASSERT_EQ(ConsoleControlInit(&console, &firmware.text, &firmware.graphics, kText), EFI_SUCCESS);
  EXPECT_EQ(firmware.screen.calls, (std::vector<std::string>{"clear", "cursor on"}));

  // GetMode's last two arguments are optional; the mode is not.
  EFI_CONSOLE_CONTROL_SCREEN_MODE mode = kGraphics;
  EXPECT_EQ(console.protocol.GetMode(&console.protocol, &mode, nullptr, nullptr), EFI_SUCCESS);
  EXPECT_EQ(mode, kText);
  EXPECT_EQ(console.protocol.GetMode(&console.protocol, nullptr, nullptr, nullptr), EFI_INVALID_PARAMETER);

  // Without graphics output there is no graphics mode, and the mode stays.
  Firmware bare;
  PlatformConsole textOnly;
  ASSERT_EQ(ConsoleControlInit(&textOnly, &bare.text, nullptr, kText), EFI_SUCCESS);
  EXPECT_EQ(textOnly.protocol.SetMode(&textOnly.protocol, kGraphics), EFI_UNSUPPORTED);
  BOOLEAN uga = 7;
  EXPECT_EQ(textOnly.protocol.GetMode(&textOnly.protocol, &mode, &uga, nullptr), EFI_SUCCESS);
  EXPECT_EQ(mode, kText);
  EXPECT_EQ(uga, FALSE);

  // A text console that fails to clear leaves the mode as it was.
  Firmware failing;
  PlatformConsole stuck;
  ASSERT_EQ(ConsoleControlInit(&stuck, &failing.text, &failing.graphics, kGraphics), EFI_SUCCESS);
  failing.screen.clearStatus = EFI_DEVICE_ERROR;
  EXPECT_EQ(stuck.protocol.SetMode(&stuck.protocol, kText), EFI_DEVICE_ERROR);
  EXPECT_EQ(stuck.protocol.GetMode(&stuck.protocol, &mode, nullptr, nullptr), EFI_SUCCESS);
  EXPECT_EQ(mode, kGraphics);
  EXPECT_EQ(stuck.protocol.LockStdIn(&stuck.protocol, nullptr), EFI_UNSUPPORTED);
}

}  // namespace
}  // namespace nimb::platform
