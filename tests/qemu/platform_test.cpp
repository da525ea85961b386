// Host tests of the platform layer's logic: its configuration file, text
// conversion, report formatting, exit codes, memory count, console modes, key
// protocols and Data Hub.
#include <gtest/gtest.h>

#include <cstdarg>
#include <cstring>
#include <string>
#include <vector>

#include "../../platform/config.h"
#include "../../platform/console_control.h"
#include "../../platform/data_hub.h"
#include "../../platform/exitcodes.h"
#include "../../platform/format.h"
#include "../../platform/key_state.h"
#include "../../platform/memory.h"

namespace nimb::platform {
namespace {

using namespace std::string_literals;

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

// Parses `text` over the defaults; the buffer stays alive with the config.
struct Parsed {
  std::vector<char> buffer;
  PlatformConfig config;
  UINT32 errors;
  std::vector<ConfigIssue> issues;  // pointers into `buffer`
  explicit Parsed(const std::string &text) : buffer(text.begin(), text.end()) {
    buffer.push_back('\x7f');
    ConfigSetDefaults(&config);
    errors = ConfigParse(
        buffer.data(), text.size(), &config,
        [](const ConfigIssue &issue, void *context) {
          static_cast<std::vector<ConfigIssue> *>(context)->push_back(issue);
        },
        &issues);
  }
};

std::vector<UINT16> KeysOf(const HeldKeys &held) {
  return std::vector<UINT16>(held.keys, held.keys + held.count);
}

TEST(PlatformConfig, ParsesHeldKeysAndBootPolicy) {
  struct Row {
    const char *name;
    std::string text;
    UINT32 errors;
    UINT16 modifiers;
    std::vector<UINT16> keys;
    bool ignored;
  };
  const std::vector<Row> rows = {
      {"nothing held by default", "", 0, 0, {}, false},
      {"shift alone", "keys=shift", 0, 0x02, {}, false},
      {"gui and v", "keys=gui+v", 0, 0x08, {0x7019}, false},
      {"gui and s", "keys=gui+s", 0, 0x08, {0x7016}, false},
      {"right shift and control", "keys=rshift+ctrl", 0, 0x21, {}, false},
      {"two keys keep their order", "keys=gui+v+s", 0, 0x08, {0x7019, 0x7016}, false},
      {"modifiers anywhere", "keys=v+rgui", 0, 0x80, {0x7019}, false},
      {"every modifier by both names",
       "keys=ctrl+lshift+alt+lgui+rctrl+rshift+ralt+rgui+lctrl+shift+lalt+gui",
       0,
       0xFF,
       {},
       false},
      {"letters, digits and usages",
       "keys=a+z+1+9+0+0x28+0xE0",
       0,
       0,
       {0x7004, 0x701D, 0x701E, 0x7026, 0x7027, 0x7028, 0x70E0},
       false},
      {"as many keys as there is room for",
       "keys=a+b+c+d+e+f+g+h",
       0,
       0,
       {0x7004, 0x7005, 0x7006, 0x7007, 0x7008, 0x7009, 0x700A, 0x700B},
       false},
      {"empty value holds nothing", "keys=gui+v\nkeys=", 0, 0, {}, false},
      {"later line replaces, not adds", "keys=shift\nkeys=gui+v", 0, 0x08, {0x7019}, false},
      {"policy ignores keys", "keys-ignored=1", 0, 0, {}, true},
      {"policy reads keys", "keys-ignored=1\nkeys-ignored=0", 0, 0, {}, false},
      {"one key too many", "keys=shift\nkeys=a+b+c+d+e+f+g+h+i", 1, 0x02, {}, false},
      {"a key twice", "keys=gui+v+v", 1, 0, {}, false},
      {"a modifier twice is still one", "keys=shift+lshift", 0, 0x02, {}, false},
      {"empty name at the end", "keys=gui+", 1, 0, {}, false},
      {"empty name at the start", "keys=+v", 1, 0, {}, false},
      {"upper case", "keys=GUI+V", 1, 0, {}, false},
      {"unknown name", "keys=cmd+v", 1, 0, {}, false},
      {"two letters", "keys=ab", 1, 0, {}, false},
      {"name too long for any key", "keys=leftshift", 1, 0, {}, false},
      {"usage without digits", "keys=0x", 1, 0, {}, false},
      {"usage zero", "keys=0x00", 1, 0, {}, false},
      {"usage beyond a byte", "keys=0x100", 1, 0, {}, false},
      {"usage not hexadecimal", "keys=0x2g", 1, 0, {}, false},
      {"blanks inside", "keys=gui + v", 1, 0, {}, false},
      {"policy of 2", "keys-ignored=2", 1, 0, {}, false},
      {"policy of 01", "keys-ignored=01", 1, 0, {}, false},
      {"policy empty", "keys-ignored=", 1, 0, {}, false},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(row.name);
    const Parsed parsed(row.text);
    EXPECT_EQ(parsed.errors, row.errors);
    EXPECT_EQ(parsed.config.keys.modifiers, row.modifiers);
    EXPECT_EQ(KeysOf(parsed.config.keys), row.keys);
    EXPECT_EQ(parsed.config.keysIgnored, row.ignored);
  }
}

// An entry as the test sees it: name, value bytes, text or not.
struct Entry {
  std::string name;
  std::string bytes;
  bool text;
  bool operator==(const Entry &other) const {
    return name == other.name && bytes == other.bytes && text == other.text;
  }
};

std::ostream &operator<<(std::ostream &out, const Entry &entry) {
  out << entry.name << (entry.text ? " text " : " bytes ");
  for (const unsigned char c : entry.bytes) {
    out << std::hex << static_cast<int>(c) << ' ';
  }
  return out << std::dec;
}

std::vector<Entry> EntriesOf(const ConfigEntryList &list) {
  std::vector<Entry> entries;
  for (UINT32 i = 0; i < list.count; i++) {
    const ConfigEntry &entry = list.entries[i];
    entries.push_back(
        {entry.name, std::string(reinterpret_cast<const char *>(entry.bytes), entry.size), entry.text});
    if (entry.text) {
      EXPECT_EQ(entry.bytes[entry.size], 0) << entry.name << ": text without its NUL";
    }
  }
  return entries;
}

TEST(PlatformConfig, ParsesVariablesAndRecords) {
  struct Row {
    const char *name;
    std::string text;
    UINT32 errors;
    std::vector<Entry> nvram;
    std::vector<Entry> records;
  };
  const std::string path("\x02\x01\x0C\x00\x7F\xFF\x04\x00", 8);
  const std::vector<Row> rows = {
      {"text variable keeps blanks and '='",
       "nvram.boot-args=-v  foo=1",
       0,
       {{"boot-args", "-v  foo=1", true}},
       {}},
      {"hex variable, blanks between bytes",
       "nvram-hex.efi-boot-file-data=02 01 0C00\t7fff0400",
       0,
       {{"efi-boot-file-data", path, false}},
       {}},
      {"text record", "datahub.Model=QEMU1,1", 0, {}, {{"Model", "QEMU1,1", true}}},
      {"quoted record keeps its blanks", "datahub.Model=\" Q \"", 0, {}, {{"Model", " Q ", true}}},
      {"hex record", "datahub-hex.Bus=00e1F505", 0, {}, {{"Bus", std::string("\x00\xE1\xF5\x05", 4), false}}},
      {"empty records", "datahub.A=\ndatahub-hex.B=", 0, {}, {{"A", "", true}, {"B", "", false}}},
      {"same name: later wins in the first place",
       "nvram.a=1\nnvram.b=2\nnvram-hex.a=ff",
       0,
       {{"a", "\xFF", false}, {"b", "2", true}},
       {}},
      {"variables and records are apart",
       "nvram.x=1\ndatahub.x=2",
       0,
       {{"x", "1", true}},
       {{"x", "2", true}}},
      {"names are case-sensitive", "datahub.m=1\ndatahub.M=2", 0, {}, {{"m", "1", true}, {"M", "2", true}}},
      {"empty variable", "nvram.a=", 1, {}, {}},
      {"blanks alone are no bytes", "nvram-hex.a=\"  \"", 1, {}, {}},
      {"odd number of digits", "nvram-hex.a=abc", 1, {}, {}},
      {"digits split by a blank", "datahub-hex.a=0 1", 1, {}, {}},
      {"not hexadecimal", "nvram-hex.a=zz", 1, {}, {}},
      {"no name", "nvram.=x\ndatahub.=y", 2, {}, {}},
      {"text beyond UCS-2", "nvram.a=\xF0\x9F\x98\x80", 1, {}, {}},
      {"name beyond UCS-2", "datahub.\xF0\x9F\x98\x80=x", 1, {}, {}},
      {"a refused line leaves the earlier value", "nvram.a=1\nnvram-hex.a=1", 1, {{"a", "1", true}}, {}},
      {"prefix alone is no key", "nvram=1\ndatahub=2", 0, {}, {}},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(row.name);
    const Parsed parsed(row.text);
    EXPECT_EQ(parsed.errors, row.errors);
    EXPECT_EQ(EntriesOf(parsed.config.nvram), row.nvram);
    EXPECT_EQ(EntriesOf(parsed.config.dataHub), row.records);
  }
}

TEST(PlatformConfig, ListsHaveRoomForTheirLimit) {
  std::string text;
  for (UINT32 i = 0; i < kMaxConfigEntries; i++) {
    text += "datahub.r" + std::to_string(i) + "=x\n";
  }
  // A known name still takes a new value when the list is full; a new one
  // doesn't fit.
  const Parsed parsed(text + "datahub.r0=y\ndatahub.extra=z\n");
  EXPECT_EQ(parsed.errors, 1u);
  ASSERT_EQ(parsed.config.dataHub.count, kMaxConfigEntries);
  EXPECT_EQ(EntriesOf(parsed.config.dataHub)[0], (Entry{"r0", "y", true}));
  ASSERT_EQ(parsed.issues.size(), 1u);
  EXPECT_EQ(parsed.issues[0].line, kMaxConfigEntries + 2);
}

TEST(PlatformConfig, ReportsRefusedValuesAsWritten) {
  struct Row {
    const char *text;
    const char *key;
    const char *value;
  };
  const std::vector<Row> rows = {
      {"keys=gui+v+v", "keys", "gui+v+v"},
      {"nvram-hex.a=01 0g", "nvram-hex.a", "01 0g"},
      // Quotes are gone by then: the value is what its key was given.
      {"datahub-hex.a=\"ab \tc\"", "datahub-hex.a", "ab \tc"},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(row.text);
    const Parsed parsed(row.text);
    ASSERT_EQ(parsed.issues.size(), 1u);
    EXPECT_EQ(parsed.issues[0].problem, kConfigBadValue);
    EXPECT_STREQ(parsed.issues[0].key, row.key);
    EXPECT_STREQ(parsed.issues[0].value, row.value);
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

EFI_STATUS EFIAPI FakeOutputString(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *, const CHAR16 *text) {
  gScreen->calls.push_back("text " + std::string(text, text + std::char_traits<char16_t>::length(text)));
  return EFI_SUCCESS;
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
    text.OutputString = FakeOutputString;
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

std::vector<std::string> *gHidden;
void Hide(const CHAR16 *text) {
  gHidden->push_back(std::string(text, text + std::char_traits<char16_t>::length(text)));
}

TEST(PlatformConsole, TheLoadersTextStaysOffAGraphicsScreen) {
  Firmware firmware;
  PlatformConsole console;
  std::vector<std::string> hidden;
  gHidden = &hidden;
  ASSERT_EQ(ConsoleControlInit(&console, &firmware.text, &firmware.graphics, kGraphics), EFI_SUCCESS);
  console.hiddenText = Hide;
  firmware.screen.calls.clear();
  EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *out = &console.screenText;
  EXPECT_EQ(out->OutputString(out, u"a"), EFI_SUCCESS);
  ASSERT_EQ(console.protocol.SetMode(&console.protocol, kText), EFI_SUCCESS);
  EXPECT_EQ(out->OutputString(out, u"b"), EFI_SUCCESS);
  // The other slots reach the firmware with its own `This`.
  EXPECT_EQ(out->EnableCursor(out, FALSE), EFI_SUCCESS);
  EXPECT_EQ(hidden, std::vector<std::string>{"a"});
  EXPECT_EQ(firmware.screen.calls, (std::vector<std::string>{"clear", "cursor on", "text b", "cursor off"}));
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

TEST(PlatformConsole, ReportsEverySetModeCall) {
  struct Call {
    UINT32 mode;
    EFI_STATUS status;
    bool operator==(const Call &other) const { return mode == other.mode && status == other.status; }
  };
  static std::vector<Call> calls;
  Firmware firmware;
  PlatformConsole console;
  ASSERT_EQ(ConsoleControlInit(&console, &firmware.text, &firmware.graphics, kGraphics), EFI_SUCCESS);
  console.onSetMode = [](EFI_CONSOLE_CONTROL_SCREEN_MODE mode, EFI_STATUS status) {
    calls.push_back({static_cast<UINT32>(mode), status});
  };
  calls.clear();
  firmware.screen.clearStatus = EFI_SUCCESS;
  const std::vector<Call> asked = {
      {kText, EFI_SUCCESS},        // a change
      {kText, EFI_SUCCESS},        // no change, still a call
      {7, EFI_INVALID_PARAMETER},  // beyond the modes
      {kGraphics, EFI_SUCCESS},    // back
  };
  for (const Call &call : asked) {
    console.protocol.SetMode(&console.protocol, static_cast<EFI_CONSOLE_CONTROL_SCREEN_MODE>(call.mode));
  }
  EXPECT_EQ(calls, asked);
  // A failed change is reported with its status.
  calls.clear();
  firmware.screen.clearStatus = EFI_DEVICE_ERROR;
  EXPECT_EQ(console.protocol.SetMode(&console.protocol, kText), EFI_DEVICE_ERROR);
  EXPECT_EQ(calls, (std::vector<Call>{{kText, EFI_DEVICE_ERROR}}));
}

// --- key protocols ------------------------------------------------------------------------

TEST(PlatformKeys, ReportsHeldKeysWithinTheCallersRoom) {
  struct Row {
    const char *name;
    const char *keys;  // the configuration's value
    UINTN room;        // the count passed in
    bool noArray;
    EFI_STATUS status;
    UINT16 modifiers;
    UINTN count;  // the count passed out
    std::vector<UINT16> written;
  };
  const std::vector<Row> rows = {
      {"nothing held", "", 32, false, EFI_SUCCESS, 0, 0, {}},
      {"shift alone", "shift", 32, false, EFI_SUCCESS, 0x02, 0, {}},
      {"gui and v", "gui+v", 32, false, EFI_SUCCESS, 0x08, 1, {0x7019}},
      {"exactly enough room", "gui+v+s", 2, false, EFI_SUCCESS, 0x08, 2, {0x7019, 0x7016}},
      {"one short", "gui+v+s", 1, false, EFI_BUFFER_TOO_SMALL, 0x08, 2, {}},
      {"no room, asking for the count", "rshift+a", 0, true, EFI_BUFFER_TOO_SMALL, 0x20, 1, {}},
      {"no room and nothing held", "ctrl", 0, true, EFI_SUCCESS, 0x01, 0, {}},
      {"room but no array", "a", 4, true, EFI_INVALID_PARAMETER, 0, 4, {}},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(row.name);
    const Parsed parsed(std::string("keys=") + row.keys);
    ASSERT_EQ(parsed.errors, 0u);
    PlatformKeyState state;
    KeyStateInit(&state, parsed.config.keys);
    std::vector<UINT16> keys(row.room + 1, 0xEEEE);
    UINT16 modifiers = 0xEEEE;
    UINTN count = row.room;
    EXPECT_EQ(
        state.protocol.ReadKeyState(&state.protocol, &modifiers, &count, row.noArray ? nullptr : keys.data()),
        row.status);
    if (row.status != EFI_INVALID_PARAMETER) {
      EXPECT_EQ(modifiers, row.modifiers);
    }
    EXPECT_EQ(count, row.count);
    std::vector<UINT16> expected = row.written;
    expected.resize(row.room + 1, 0xEEEE);
    EXPECT_EQ(keys, expected) << "wrote where it should not";
  }
  PlatformKeyState state;
  KeyStateInit(&state, {});
  UINT16 modifiers = 0;
  UINTN count = 0;
  EXPECT_EQ(state.protocol.ReadKeyState(&state.protocol, nullptr, &count, nullptr), EFI_INVALID_PARAMETER);
  EXPECT_EQ(state.protocol.ReadKeyState(&state.protocol, &modifiers, nullptr, nullptr),
            EFI_INVALID_PARAMETER);
}

TEST(PlatformKeys, BootPolicyAnswersAsConfigured) {
  for (const bool ignored : {false, true}) {
    SCOPED_TRACE(ignored);
    PlatformBootPolicy policy;
    BootPolicyInit(&policy, ignored);
    UINT64 answer = 0xEEEE;
    EXPECT_EQ(policy.protocol.GetKeysIgnored(&policy.protocol, &answer), EFI_SUCCESS);
    EXPECT_EQ(answer, ignored ? 1u : 0u);
    EXPECT_EQ(policy.protocol.GetKeysIgnored(&policy.protocol, nullptr), EFI_INVALID_PARAMETER);
  }
}

// --- Data Hub -------------------------------------------------------------------------------

// A hub built from configuration text, in 8-byte aligned storage.
struct Hub {
  Parsed parsed;
  std::vector<UINT64> storage;
  PlatformDataHub hub;
  explicit Hub(const std::string &text) : parsed(text) {
    EXPECT_EQ(parsed.errors, 0u);
    const UINTN size = DataHubBuildRecords(parsed.config.dataHub, nullptr, 0);
    storage.assign(size / 8 + 1, 0xEEEEEEEEEEEEEEEEULL);
    EXPECT_EQ(DataHubBuildRecords(parsed.config.dataHub, Bytes(), size), size);
    EXPECT_EQ(storage.back(), 0xEEEEEEEEEEEEEEEEULL) << "wrote past its size";
    DataHubInit(&hub, Bytes(), size);
  }
  UINT8 *Bytes() { return reinterpret_cast<UINT8 *>(storage.data()); }
  EFI_STATUS Next(UINT64 *count, EFI_DATA_RECORD_HEADER **record, EFI_EVENT *filter = nullptr) {
    return hub.protocol.GetNextDataRecord(&hub.protocol, count, filter, record);
  }
};

// A record as the loader reads it.
struct Record {
  bool vendor;
  std::u16string name;
  std::string value;
  bool operator==(const Record &other) const {
    return vendor == other.vendor && name == other.name && value == other.value;
  }
};

std::ostream &operator<<(std::ostream &out, const Record &record) {
  out << (record.vendor ? "vendor " : "other ") << record.name.size() << " units, value";
  for (const unsigned char c : record.value) {
    out << ' ' << std::hex << static_cast<int>(c);
  }
  return out << std::dec;
}

Record Read(const EFI_DATA_RECORD_HEADER *header) {
  EXPECT_EQ(reinterpret_cast<uintptr_t>(header) % 8, 0u) << "record not aligned";
  EXPECT_EQ(header->Version, EFI_DATA_RECORD_HEADER_VERSION);
  EXPECT_EQ(header->HeaderSize, sizeof(EFI_DATA_RECORD_HEADER));
  EXPECT_EQ(header->DataRecordClass, EFI_DATA_RECORD_CLASS_DATA);
  const auto *record = reinterpret_cast<const NIMB_PLATFORM_RECORD *>(header);
  EXPECT_EQ(header->RecordSize, sizeof(NIMB_PLATFORM_RECORD) + record->NameSize + record->ValueSize);
  EXPECT_EQ(record->NameSize % 2, 0u);
  const auto *data = reinterpret_cast<const char *>(record + 1);
  std::u16string name(record->NameSize / 2, u'\0');
  std::memcpy(name.data(), data, record->NameSize);
  return {std::memcmp(&header->ProducerName, &gNimbPlatformProducerGuid, sizeof(EFI_GUID)) == 0, name,
          std::string(data + record->NameSize, record->ValueSize)};
}

std::string Wide(const std::u16string &text) {
  return std::string(reinterpret_cast<const char *>(text.data()), text.size() * 2);
}

TEST(PlatformDataHub, HoldsTheConfiguredRecordsThenOneOfItsOwn) {
  struct Row {
    const char *name;
    std::string text;
    std::vector<Record> records;  // in the hub's order, the closing one included
  };
  const Record closing = {false, u"", ""};
  const std::vector<Row> rows = {
      {"no records", "", {closing}},
      {"text as UCS-2 with its NUL",
       "datahub.Model=QEMU1,1",
       {{true, u"Model\0"s, Wide(u"QEMU1,1\0"s)}, closing}},
      {"bytes as they are, odd sizes keep alignment",
       "datahub-hex.A=010203\ndatahub.B=\xC3\xA9\ndatahub-hex.C=",
       {{true, u"A\0"s, "\x01\x02\x03"}, {true, u"B\0"s, Wide(u"\u00E9\0"s)}, {true, u"C\0"s, ""}, closing}},
      {"empty text is one NUL unit", "datahub.Model=", {{true, u"Model\0"s, Wide(u"\0"s)}, closing}},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(row.name);
    Hub hub(row.text);
    std::vector<Record> records;
    std::vector<UINT64> counts;
    UINT64 count = 0;
    do {
      EFI_DATA_RECORD_HEADER *record = nullptr;
      ASSERT_EQ(hub.Next(&count, &record), EFI_SUCCESS);
      ASSERT_LT(records.size(), row.records.size()) << "the walk does not end";
      records.push_back(Read(record));
      counts.push_back(record->LogMonotonicCount);
    } while (count != 0);
    EXPECT_EQ(records, row.records);
    for (size_t i = 0; i < counts.size(); i++) {
      EXPECT_EQ(counts[i], i + 1) << "monotonic counts start at 1";
    }
  }
}

TEST(PlatformDataHub, FollowsTheMonotonicCount) {
  Hub hub("datahub.A=1\ndatahub.B=2\n");  // counts 1, 2 and 3 (the closing record)
  struct Row {
    const char *name;
    UINT64 count;
    EFI_STATUS status;
    UINT64 next;
    UINT64 recordCount;  // of the record returned
  };
  const std::vector<Row> rows = {
      {"0 starts", 0, EFI_SUCCESS, 2, 1},
      {"the middle", 2, EFI_SUCCESS, 3, 2},
      {"the last gives 0", 3, EFI_SUCCESS, 0, 3},
      {"beyond the last", 4, EFI_NOT_FOUND, 4, 0},
      {"far beyond", ~0ULL, EFI_NOT_FOUND, ~0ULL, 0},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(row.name);
    UINT64 count = row.count;
    EFI_DATA_RECORD_HEADER *record = nullptr;
    EXPECT_EQ(hub.Next(&count, &record), row.status);
    EXPECT_EQ(count, row.next);
    if (row.status == EFI_SUCCESS) {
      ASSERT_NE(record, nullptr);
      EXPECT_EQ(record->LogMonotonicCount, row.recordCount);
    }
  }
  UINT64 count = 0;
  EFI_DATA_RECORD_HEADER *record = nullptr;
  EFI_EVENT filter = reinterpret_cast<EFI_EVENT>(1);
  EXPECT_EQ(hub.Next(&count, &record, &filter), EFI_INVALID_PARAMETER) << "no filter drivers exist";
  EFI_EVENT none = nullptr;
  EXPECT_EQ(hub.Next(&count, &record, &none), EFI_SUCCESS);
  EXPECT_EQ(hub.Next(nullptr, &record), EFI_INVALID_PARAMETER);
  EXPECT_EQ(hub.Next(&count, nullptr), EFI_INVALID_PARAMETER);

  PlatformDataHub empty;
  DataHubInit(&empty, nullptr, 0);
  count = 0;
  EXPECT_EQ(empty.protocol.GetNextDataRecord(&empty.protocol, &count, nullptr, &record), EFI_NOT_FOUND);
}

TEST(PlatformDataHub, WritesNothingIntoTooSmallABuffer) {
  const Parsed parsed("datahub.Model=QEMU1,1\n");
  const UINTN size = DataHubBuildRecords(parsed.config.dataHub, nullptr, 0);
  std::vector<UINT64> storage(size / 8, 0xEEEEEEEEEEEEEEEEULL);
  EXPECT_EQ(DataHubBuildRecords(parsed.config.dataHub, reinterpret_cast<UINT8 *>(storage.data()), size - 1),
            size);
  EXPECT_EQ(storage, std::vector<UINT64>(size / 8, 0xEEEEEEEEEEEEEEEEULL));
}

}  // namespace
}  // namespace nimb::platform
