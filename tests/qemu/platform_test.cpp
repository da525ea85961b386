// Host tests of the platform layer's logic: its configuration file, text
// conversion, exit codes, memory count, console modes, screen facts, held
// keys from the keyboard, the firmware's own protocols and the Data Hub.
// The protocols that only pass the configuration on (device properties,
// network boot answers) are checked end to end by the QEMU scenarios, whose
// kernel reports what it got.
#include <gtest/gtest.h>

#include <cstring>
#include <iomanip>
#include <sstream>
#include <string>
#include <vector>

#include "../../platform/config.h"
#include "../../platform/console_control.h"
#include "../../platform/data_hub.h"
#include "../../platform/exitcodes.h"
#include "../../platform/format.h"
#include "../../platform/graphics.h"
#include "../../platform/key_state.h"
#include "../../platform/machine.h"
#include "../../platform/memory.h"
#include "hostfw/hostfw.h"

namespace nimb::platform {
namespace {

using namespace std::string_literals;

constexpr auto kText = EfiConsoleControlScreenText;
constexpr auto kGraphics = EfiConsoleControlScreenGraphics;

// Parses `text` over the defaults; the buffer stays alive with the config.
struct Parsed {
  std::vector<char> buffer;
  PlatformConfig config;
  UINT32 errors;
  std::string issues;  // " unknown@1:key", " noequals@1:line", " bad@1:key=value"
  explicit Parsed(const std::string &text) : buffer(text.begin(), text.end()) {
    buffer.push_back('\x7f');  // the byte behind the text, which the parser may overwrite
    ConfigSetDefaults(&config);
    errors = ConfigParse(
        buffer.data(), text.size(), &config,
        [](const ConfigIssue &issue, void *context) {
          static const char *const kNames[] = {"unknown", "noequals", "bad"};
          // As the log echoes them.
          char key[kConfigEchoCapacity];
          char value[kConfigEchoCapacity];
          ConfigEcho(issue.key, key, sizeof(key));
          ConfigEcho(issue.value != nullptr ? issue.value : "", value, sizeof(value));
          *static_cast<std::string *>(context) += " "s + kNames[issue.problem] + "@" +
                                                  std::to_string(issue.line) + ":" + key +
                                                  (issue.value != nullptr ? "="s + value : "");
        },
        &issues);
  }
};

std::string Hex(const UINT8 *bytes, size_t size) {
  std::ostringstream out;
  for (size_t i = 0; i < size; i++) {
    out << "0123456789abcdef"[bytes[i] >> 4] << "0123456789abcdef"[bytes[i] & 15];
  }
  return out.str();
}

void AddEntries(std::ostringstream &out, const char *what, const ConfigEntryList &list) {
  for (UINT32 i = 0; i < list.count; i++) {
    const ConfigEntry &entry = list.entries[i];
    static const char *const kLives[] = {"", "/boot", "/delete"};
    out << what << entry.name << kLives[entry.life] << '=';
    if (entry.text) {
      EXPECT_EQ(entry.bytes[entry.size], 0) << entry.name << ": text without its NUL";
      out << '"' << std::string(reinterpret_cast<const char *>(entry.bytes), entry.size) << "\" ";
    } else {
      out << Hex(entry.bytes, entry.size) << ' ';
    }
  }
}

void AddBytes(std::ostringstream &out, const char *what, const ConfigBytes &bytes) {
  if (bytes.bytes != nullptr) {
    out << what << '=' << Hex(bytes.bytes, bytes.size) << ' ';
  }
}

// What a configuration text sets, beyond the defaults, its error count and
// its issues, in one line.
std::string Summary(const std::string &text) {
  const Parsed parsed(text);
  const PlatformConfig &config = parsed.config;
  std::ostringstream out;
  if (strcmp(config.loaderPath, kDefaultLoaderPath) != 0) {
    out << "loader=" << config.loaderPath << ' ';
  }
  if (config.options != nullptr) {
    out << "options=[" << config.options << "] ";
  }
  if (config.consoleMode != kGraphics) {
    out << "console=" << config.consoleMode << ' ';
  }
  if (config.holdSeconds != 0) {
    out << "hold=" << config.holdSeconds << ' ';
  }
  if (config.debugExit != kDebugExitAuto) {
    out << "debug-exit=" << int{config.debugExit} << ' ';
  }
  if (config.waitKey) {
    out << "wait-key ";
  }
  if (config.keys.modifiers != 0) {
    out << "modifiers=" << std::hex << config.keys.modifiers << std::dec << ' ';
  }
  for (UINT32 i = 0; i < config.keys.count; i++) {
    out << "key=" << std::hex << config.keys.keys[i] << std::dec << ' ';
  }
  if (config.keysGiven && config.keys.modifiers == 0 && config.keys.count == 0) {
    out << "nothing-held ";  // the keyboard is not read
  }
  if (config.keysIgnored) {
    out << "ignored ";
  }
  if (config.replaceFirmwareProtocols) {
    out << "replace ";
  }
  AddEntries(out, "nvram.", config.nvram);
  AddEntries(out, "datahub.", config.dataHub);
  AddBytes(out, "properties", config.deviceProperties);
  AddBytes(out, "dhcp", config.dhcpResponse);
  AddBytes(out, "bsdp", config.bsdpResponse);
  out << "errors=" << parsed.errors << parsed.issues;
  return out.str();
}

TEST(PlatformConfig, ParsesEveryKey) {
  struct Row {
    std::string text;
    std::string summary;
  };
  const std::vector<Row> rows = {
      // Lines, keys and values.
      {"", "errors=0"},
      {"loader=\\a.efi\noptions=-v\nconsole=text\nhold=3\n",
       "loader=\\a.efi options=[-v] console=0 hold=3 errors=0"},
      {"# comment\r\n\r\n  # indented\r\n\thold = 12 \r\nconsole=graphics", "hold=12 errors=0"},
      {"options= a=b  c \n", "options=[a=b  c] errors=0"},
      {"options=\n", "options=[] errors=0"},
      {"options=\"  \\t-v\\n\\\"q\\\"\\\\ \"\n", "options=[  \t-v\n\"q\"\\ ] errors=0"},
      {"hold=1\nhold=2\n", "hold=2 errors=0"},
      {"colour=blue\nHold=1\n", "errors=0 unknown@1:colour=blue unknown@2:Hold=1"},
      {"hold 3\nconsole=text\n", "console=0 errors=1 noequals@1:hold 3"},
      {"console=vga\n", "errors=1 bad@1:console=vga"},
      {"console=none\n", "console=2 errors=0"},
      {"\nhold=3s\nhold=-1\nhold=3601\n", "errors=3 bad@2:hold=3s bad@3:hold=-1 bad@4:hold=3601"},
      {"hold=3600\n", "hold=3600 errors=0"},
      // How the run ends.
      {"debug-exit=1\nwait-key=1", "debug-exit=1 wait-key errors=0"},
      {"debug-exit=0\ndebug-exit=auto\nwait-key=1\nwait-key=0", "errors=0"},
      {"debug-exit=0", "debug-exit=0 errors=0"},
      {"debug-exit=yes\ndebug-exit=Auto\nwait-key=2",
       "errors=3 bad@1:debug-exit=yes bad@2:debug-exit=Auto bad@3:wait-key=2"},
      {"loader=\n", "errors=1 bad@1:loader="},
      {"options=\"-v\n", "errors=1 bad@1:options=\"-v"},
      {"options=\"a\"b\"\n", "errors=1 bad@1:options=\"a\"b\""},
      {"options=\"a\\\"\n", "errors=1 bad@1:options=\"a\\\""},
      {"options=\"\\q\"\n", "errors=1 bad@1:options=\"\\q\""},
      {"options=\xF0\x9F\x98\x80\n", "errors=1 bad@1:options=\\xf0\\x9f\\x98\\x80"},
      // A byte-order mark is skipped at the start only; echoes are bounded
      // and show control bytes as escapes.
      {"\xEF\xBB\xBFhold=3\n", "hold=3 errors=0"},
      {"\xEF\xBB\xBF", "errors=0"},
      {"hold=1\n\xEF\xBB\xBFhold=2", "hold=1 errors=0 unknown@2:\\xef\\xbb\\xbfhold=2"},
      {"\xEF\xBBhold=2", "errors=0 unknown@1:\\xef\\xbbhold=2"},
      {"k\x1b[2J\x07=\x7f", "errors=0 unknown@1:k\\x1b[2J\\x07=\\x7f"},
      {"console=" + std::string(70, 'v'), "errors=1 bad@1:console=" + std::string(60, 'v') + "..."},
      {"console=" + std::string(63, 'v'), "errors=1 bad@1:console=" + std::string(63, 'v')},
      {"console=" + std::string(64, 'v'), "errors=1 bad@1:console=" + std::string(60, 'v') + "..."},
      {"console=" + std::string(14, 'v') + "\x01" + std::string(60, 'v'),
       "errors=1 bad@1:console=" + std::string(14, 'v') + "\\x01" + std::string(42, 'v') + "..."},
      {"console=" + std::string(59, 'v') + "\x01\x01",
       "errors=1 bad@1:console=" + std::string(59, 'v') + "..."},
      {std::string("hold=1\0junk\nconsole=text", 24), "console=0 hold=1 errors=1 noequals@2:junk"},
      // Held keys and the boot policy.
      {"keys=gui+v+s", "modifiers=8 key=7019 key=7016 errors=0"},
      {"keys=v+rgui\nkeys=rshift+ctrl", "modifiers=21 errors=0"},
      {"keys=ctrl+lshift+alt+lgui+rctrl+rshift+ralt+rgui+lctrl+shift+lalt+gui", "modifiers=ff errors=0"},
      {"keys=a+z+1+9+0+0x28+0xE0", "key=7004 key=701d key=701e key=7026 key=7027 key=7028 key=70e0 errors=0"},
      {"keys=a+b+c+d+e+f+g+h",
       "key=7004 key=7005 key=7006 key=7007 key=7008 key=7009 key=700a key=700b errors=0"},
      {"keys=gui+v\nkeys=", "nothing-held errors=0"},
      {"keys=shift+lshift\nkeys-ignored=1", "modifiers=2 ignored errors=0"},
      {"keys-ignored=1\nkeys-ignored=0", "errors=0"},
      {"keys=shift\nkeys=a+b+c+d+e+f+g+h+i", "modifiers=2 errors=1 bad@2:keys=a+b+c+d+e+f+g+h+i"},
      {"keys=gui+v+v\nkeys=gui+\nkeys=+v\nkeys=GUI+V\nkeys=cmd+v\nkeys=ab\nkeys=leftshift",
       "errors=7 bad@1:keys=gui+v+v bad@2:keys=gui+ bad@3:keys=+v bad@4:keys=GUI+V bad@5:keys=cmd+v "
       "bad@6:keys=ab bad@7:keys=leftshift"},
      {"keys=0x\nkeys=0x00\nkeys=0x100\nkeys=0x2g\nkeys=gui + v",
       "errors=5 bad@1:keys=0x bad@2:keys=0x00 bad@3:keys=0x100 bad@4:keys=0x2g bad@5:keys=gui + v"},
      {"firmware-protocols=replace", "replace errors=0"},
      {"firmware-protocols=replace\nfirmware-protocols=keep\nfirmware-protocols=Replace",
       "errors=1 bad@3:firmware-protocols=Replace"},
      {"keys-ignored=2\nkeys-ignored=01\nkeys-ignored=",
       "errors=3 bad@1:keys-ignored=2 bad@2:keys-ignored=01 bad@3:keys-ignored="},
      // Variables and platform records.
      {"nvram.boot-args=-v  foo=1", "nvram.boot-args=\"-v  foo=1\" errors=0"},
      {"nvram-hex.p=02 01 0C00\t7fff0400", "nvram.p=02010c007fff0400 errors=0"},
      {"nvram-volatile.a=x\nnvram-volatile-hex.b=0a\nnvram-delete.c=",
       "nvram.a/boot=\"x\" nvram.b/boot=0a nvram.c/delete=\"\" errors=0"},
      {"nvram.a=1\nnvram-delete.b=\nnvram-volatile.a=2\nnvram-hex.b=03",
       "nvram.a/boot=\"2\" nvram.b=03 errors=0"},
      {"nvram-delete.a=1\nnvram-delete.=\nnvram-volatile.a=\nnvram-volatile-hex.a=0",
       "errors=4 bad@1:nvram-delete.a=1 bad@2:nvram-delete.= bad@3:nvram-volatile.a= "
       "bad@4:nvram-volatile-hex.a=0"},
      {"datahub.Model=\" Q \"\ndatahub-hex.Bus=00e1F505",
       "datahub.Model=\" Q \" datahub.Bus=00e1f505 errors=0"},
      {"datahub.A=\ndatahub-hex.B=", "datahub.A=\"\" datahub.B= errors=0"},
      {"nvram.a=1\nnvram.b=2\nnvram-hex.a=ff", "nvram.a=ff nvram.b=\"2\" errors=0"},
      {"nvram.x=1\ndatahub.x=2\ndatahub.X=3", "nvram.x=\"1\" datahub.x=\"2\" datahub.X=\"3\" errors=0"},
      {"nvram.a=\nnvram-hex.a=\"  \"", "errors=2 bad@1:nvram.a= bad@2:nvram-hex.a=  "},
      {"nvram-hex.a=abc\ndatahub-hex.a=0 1\nnvram-hex.a=zz",
       "errors=3 bad@1:nvram-hex.a=abc bad@2:datahub-hex.a=0 1 bad@3:nvram-hex.a=zz"},
      {"nvram.=x\ndatahub.=y", "errors=2 bad@1:nvram.=x bad@2:datahub.=y"},
      {"nvram.a=\xF0\x9F\x98\x80\ndatahub.\xF0\x9F\x98\x80=x",
       "errors=2 bad@1:nvram.a=\\xf0\\x9f\\x98\\x80 bad@2:datahub.\\xf0\\x9f\\x98\\x80=x"},
      {"nvram.a=1\nnvram-hex.a=1", "nvram.a=\"1\" errors=1 bad@2:nvram-hex.a=1"},
      {"nvram=1\ndatahub=2", "errors=0 unknown@1:nvram=1 unknown@2:datahub=2"},
      {"datahub-hex.a=\"ab \tc\"", "errors=1 bad@1:datahub-hex.a=ab \\x09c"},
      // The answers of the device properties and network boot protocols.
      {"device-properties-hex=01\nnetboot.dhcp-hex=0203\nnetboot.bsdp-hex=040506",
       "properties=01 dhcp=0203 bsdp=040506 errors=0"},
      {"device-properties-hex=\nnetboot.bsdp-hex=", "properties= bsdp= errors=0"},
      {"netboot.dhcp-hex= aB\tcd  EF \nnetboot.bsdp-hex=01\nnetboot.bsdp-hex=0203",
       "dhcp=abcdef bsdp=0203 errors=0"},
      {"device-properties-hex=0a\ndevice-properties-hex=0g\nnetboot.bsdp-hex=123",
       "properties=0a errors=2 bad@2:device-properties-hex=0g bad@3:netboot.bsdp-hex=123"},
      {"netboot.dhcp=01\nnetboot.hex=01", "errors=0 unknown@1:netboot.dhcp=01 unknown@2:netboot.hex=01"},
  };
  for (const Row &row : rows) {
    EXPECT_EQ(Summary(row.text), row.summary) << row.text;
  }
  // A blob of several KiB, with and without blanks.
  std::string blob;
  std::string hex;
  for (size_t i = 0; i < 12000; i++) {
    blob.push_back(static_cast<char>(i * 7 + i / 256));
    hex += Hex(reinterpret_cast<const UINT8 *>(&blob.back()), 1) + (i % 2 ? " " : "");
  }
  const Parsed parsed("device-properties-hex=" + hex);
  ASSERT_EQ(parsed.errors, 0u);
  EXPECT_EQ(std::string(reinterpret_cast<const char *>(parsed.config.deviceProperties.bytes),
                        parsed.config.deviceProperties.size),
            blob);
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
  EXPECT_EQ(parsed.config.dataHub.entries[0].bytes[0], 'y');
  EXPECT_EQ(parsed.issues, " bad@" + std::to_string(kMaxConfigEntries + 2) + ":datahub.extra=z");
}

TEST(PlatformConfig, ConvertsUtf8ToUcs2) {
  struct Row {
    const char *text;
    size_t capacity;  // units, the NUL counted
    bool valid;       // well-formed and within U+FFFF
    bool fits;
    std::u16string wide;
  };
  const std::vector<Row> rows = {
      {"\\EFI\\a", 16, true, true, u"\\EFI\\a"},
      {"", 1, true, true, u""},
      {"\xC3\xA9-\xE2\x82\xAC", 16, true, true, u"\u00E9-\u20AC"},
      {"\xEF\xBF\xBF", 2, true, true, u"\uFFFF"},
      {"abc", 4, true, true, u"abc"},
      {"abc", 3, true, false, u""},
      {"", 0, true, false, u""},
      {"\xF0\x9F\x98\x80", 16, false, false, u""},  // beyond U+FFFF
      {"\xC0\xAF", 16, false, false, u""},          // overlong
      {"\xE0\x80\xAF", 16, false, false, u""},
      {"\xED\xA0\x80", 16, false, false, u""},  // surrogate
      {"a\x80", 16, false, false, u""},
      {"a\xE2\x82", 16, false, false, u""},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(row.text);
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

// --- what the harness reads: exit codes and the memory count --------------------------

TEST(PlatformReport, ExitCodesAndBoundedText) {
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
    EXPECT_EQ(ExitCodeForOutcome(row.status, row.changed), row.code) << StatusName(row.status);
  }
  char small[8];
  EXPECT_EQ(FormatToBuffer(small, sizeof(small), "%s=%u", "memory", UINT64{123}), 10u);
  EXPECT_STREQ(small, "memory=");
}

// An SMBIOS structure: header (type, length, handle), the formatted bytes
// behind it, then the strings and the closing NUL.
std::string Structure(UINT8 type, const std::string &formatted, const std::vector<std::string> &strings) {
  std::string out = {static_cast<char>(type), static_cast<char>(4 + formatted.size()), 1, 0};
  out += formatted;
  for (const std::string &text : strings) {
    out += text + '\0';
  }
  return out + (strings.empty() ? "\0\0"s : "\0"s);
}

TEST(PlatformMachine, FindsTheSystemManufacturer) {
  const std::string bios = Structure(0, "\x01\x02", {"EDK II", "unknown"});
  const std::string end = Structure(127, "", {});
  struct Row {
    const char *name;
    std::string table;
    bool qemu;
  };
  const std::vector<Row> rows = {
      {"first string", bios + Structure(1, "\x01\x02", {"QEMU", "Standard PC"}) + end, true},
      {"second string", bios + Structure(1, "\x02\x01", {"Standard PC", "QEMU"}) + end, true},
      {"another maker", Structure(1, "\x01", {"QEMU Inc"}) + end, false},
      {"no string number", Structure(1, "\x00", {"QEMU"}) + end, false},
      {"a number beyond the strings", Structure(1, "\x03", {"QEMU", "x"}) + end, false},
      {"no manufacturer field", Structure(1, "", {"QEMU"}) + end, false},
      {"the end before it", end + Structure(1, "\x01", {"QEMU"}), false},
      {"cut in the strings", (bios + Structure(1, "\x01", {"QEMU"})).substr(0, bios.size() + 7), false},
      {"a header shorter than 4", "\x01\x03\x00\x00QEMU\0\0"s, false},
  };
  for (const Row &row : rows) {
    EXPECT_EQ(SmbiosManufacturerIs(reinterpret_cast<const UINT8 *>(row.table.data()), row.table.size(), "QEMU"),
              row.qemu)
        << row.name;
  }
}

TEST(PlatformMemory, CountsConventionalPagesByTheFirmwaresStride) {
  const std::vector<std::pair<UINT32, UINT64>> regions = {
      {EfiConventionalMemory, 100}, {EfiBootServicesData, 7},   {EfiConventionalMemory, 23},
      {EfiLoaderData, 5},           {EfiConventionalMemory, 1},
  };
  // The structure's own stride, OVMF's wider one, and a cut-off descriptor
  // at the end that is not counted.
  for (const auto &[stride, extraBytes] :
       std::vector<std::pair<UINTN, UINTN>>{{sizeof(EFI_MEMORY_DESCRIPTOR), 0}, {0x30, 0}, {0x30, 0x20}}) {
    std::vector<UINT8> map(regions.size() * stride + extraBytes, 0xEE);
    for (size_t i = 0; i <= regions.size(); i++) {
      EFI_MEMORY_DESCRIPTOR descriptor = {};
      descriptor.Type = i < regions.size() ? regions[i].first : EfiConventionalMemory;
      descriptor.NumberOfPages = i < regions.size() ? regions[i].second : 1000;
      std::memcpy(&map[i * stride], &descriptor, i < regions.size() ? sizeof(descriptor) : extraBytes);
    }
    EXPECT_EQ(CountConventionalPages(map.data(), map.size(), stride), 124u) << stride << " " << extraBytes;
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

TEST(PlatformConsole, SwitchesModesOnTheRealConsole) {
  using Calls = std::vector<std::string>;
  struct Row {
    const char *name;
    EFI_CONSOLE_CONTROL_SCREEN_MODE start;
    UINT32 wanted;
    bool graphics;  // the firmware has graphics output
    EFI_STATUS clear;
    EFI_STATUS status;
    EFI_CONSOLE_CONTROL_SCREEN_MODE after;
    Calls calls;  // of SetMode only
  };
  const std::vector<Row> rows = {
      {"text to graphics",
       kText,
       kGraphics,
       true,
       EFI_SUCCESS,
       EFI_SUCCESS,
       kGraphics,
       {"cursor off", "blt 0 black 0,0 1280x800"}},
      {"graphics to text", kGraphics, kText, true, EFI_SUCCESS, EFI_SUCCESS, kText, {"clear", "cursor on"}},
      {"text to text", kText, kText, true, EFI_SUCCESS, EFI_SUCCESS, kText, {}},
      {"graphics to graphics", kGraphics, kGraphics, true, EFI_SUCCESS, EFI_SUCCESS, kGraphics, {}},
      {"beyond the modes", kText, 2, true, EFI_SUCCESS, EFI_INVALID_PARAMETER, kText, {}},
      {"far beyond", kGraphics, 0xFFFFFFFF, true, EFI_SUCCESS, EFI_INVALID_PARAMETER, kGraphics, {}},
      {"no graphics output", kText, kGraphics, false, EFI_SUCCESS, EFI_UNSUPPORTED, kText, {}},
      // Graphics asked for at the start without graphics output: text.
      {"no graphics output at all", kGraphics, kGraphics, false, EFI_SUCCESS, EFI_UNSUPPORTED, kText, {}},
      {"a clear that fails",
       kGraphics,
       kText,
       true,
       EFI_DEVICE_ERROR,
       EFI_DEVICE_ERROR,
       kGraphics,
       {"clear"}},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(row.name);
    Firmware firmware;
    PlatformConsole console;
    ASSERT_EQ(
        ConsoleControlInit(&console, &firmware.text, row.graphics ? &firmware.graphics : nullptr, row.start),
        EFI_SUCCESS);
    firmware.screen.calls.clear();
    firmware.screen.clearStatus = row.clear;
    EXPECT_EQ(
        console.protocol.SetMode(&console.protocol, static_cast<EFI_CONSOLE_CONTROL_SCREEN_MODE>(row.wanted)),
        row.status);
    EXPECT_EQ(firmware.screen.calls, row.calls);
    EFI_CONSOLE_CONTROL_SCREEN_MODE mode = EfiConsoleControlScreenMaxValue;
    BOOLEAN uga = 7;
    BOOLEAN locked = 7;
    ASSERT_EQ(console.protocol.GetMode(&console.protocol, &mode, &uga, &locked), EFI_SUCCESS);
    EXPECT_EQ(mode, row.after);
    EXPECT_EQ(uga, row.graphics);
    EXPECT_EQ(locked, FALSE);
    EXPECT_EQ(console.protocol.GetMode(&console.protocol, nullptr, nullptr, nullptr), EFI_INVALID_PARAMETER);
  }
}

// --- Data Hub -------------------------------------------------------------------------------

// A hub built from configuration text, in 8-byte aligned storage.
struct Hub {
  Parsed parsed;
  std::vector<UINT64> storage;
  PlatformDataHub hub;
  explicit Hub(const std::string &text) : parsed(text) {
    const UINTN size = DataHubBuildRecords(parsed.config.dataHub, nullptr, 0);
    storage.assign(size / 8 + 1, 0xEEEEEEEEEEEEEEEEULL);
    EXPECT_EQ(DataHubBuildRecords(parsed.config.dataHub, Bytes(), size - 1), size);
    EXPECT_EQ(storage, std::vector<UINT64>(size / 8 + 1, 0xEEEEEEEEEEEEEEEEULL)) << "wrote into too small";
    EXPECT_EQ(DataHubBuildRecords(parsed.config.dataHub, Bytes(), size), size);
    EXPECT_EQ(storage.back(), 0xEEEEEEEEEEEEEEEEULL) << "wrote past its size";
    DataHubInit(&hub, Bytes(), size);
  }
  UINT8 *Bytes() { return reinterpret_cast<UINT8 *>(storage.data()); }
  EFI_STATUS Next(UINT64 *count, EFI_DATA_RECORD_HEADER **record, EFI_EVENT *filter = nullptr) {
    return hub.protocol.GetNextDataRecord(&hub.protocol, count, filter, record);
  }
};

// A record as the loader reads it: vendor or not, name and value in hex.
std::string Read(const EFI_DATA_RECORD_HEADER *header) {
  EXPECT_EQ(reinterpret_cast<uintptr_t>(header) % 8, 0u) << "record not aligned";
  EXPECT_EQ(header->Version, EFI_DATA_RECORD_HEADER_VERSION);
  EXPECT_EQ(header->HeaderSize, sizeof(EFI_DATA_RECORD_HEADER));
  EXPECT_EQ(header->DataRecordClass, EFI_DATA_RECORD_CLASS_DATA);
  const auto *record = reinterpret_cast<const NIMB_PLATFORM_RECORD *>(header);
  EXPECT_EQ(header->RecordSize, sizeof(NIMB_PLATFORM_RECORD) + record->NameSize + record->ValueSize);
  const auto *data = reinterpret_cast<const UINT8 *>(record + 1);
  const bool vendor = std::memcmp(&header->ProducerName, &gNimbPlatformProducerGuid, sizeof(EFI_GUID)) == 0;
  return (vendor ? "" : "other ") + Hex(data, record->NameSize) + "=" +
         Hex(data + record->NameSize, record->ValueSize);
}

TEST(PlatformDataHub, HoldsTheConfiguredRecordsThenOneOfItsOwn) {
  // Texts as UCS-2 with their NUL, bytes as they are, odd sizes aligned;
  // monotonic counts from 1, the next count 0 behind the closing record.
  Hub hub("datahub.Model=QE\ndatahub-hex.A=010203\ndatahub.B=\xC3\xA9\ndatahub-hex.C=\ndatahub.D=");
  const std::vector<std::string> expected = {"4d006f00640065006c000000=510045000000",
                                             "41000000=010203",
                                             "42000000=e9000000",
                                             "43000000=",
                                             "44000000=0000",
                                             "other ="};
  for (const UINT64 asked : {0ULL, 1ULL, 2ULL, 5ULL, 6ULL, 7ULL, ~0ULL}) {
    SCOPED_TRACE(asked);
    UINT64 count = asked;
    EFI_DATA_RECORD_HEADER *record = nullptr;
    const UINT64 index = asked == 0 ? 1 : asked;  // the count of the record that comes
    if (index > expected.size()) {
      EXPECT_EQ(hub.Next(&count, &record), EFI_NOT_FOUND);
      EXPECT_EQ(count, asked);
      continue;
    }
    ASSERT_EQ(hub.Next(&count, &record), EFI_SUCCESS);
    EXPECT_EQ(record->LogMonotonicCount, index);
    EXPECT_EQ(count, index == expected.size() ? 0 : index + 1);
    EXPECT_EQ(Read(record), expected[index - 1]);
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

// --- screen facts ------------------------------------------------------------------------

// GetInfo's answer ("-" when refused, having written nothing) and UGA's depth.
TEST(PlatformGraphics, FrameBufferOnlyForBgrxBelow4GiB) {
  constexpr UINT64 k4G = 1ULL << 32, kAll = 1024 * 4 * 768;
  constexpr auto kBgrx = PixelBlueGreenRedReserved8BitPerColor;
  struct Row {
    EFI_GRAPHICS_PIXEL_FORMAT format;
    EFI_PIXEL_BITMASK masks;
    UINT64 base, size;
    UINT32 scanLine;
    const char *facts;
  };
  const std::vector<Row> rows = {
      {kBgrx, {}, 0x80000000, kAll, 1024, "80000000 300000 4096 1024x768x32 uga 32"},
      {kBgrx, {}, k4G - kAll, kAll, 1024, "ffd00000 300000 4096 1024x768x32 uga 32"},
      {kBgrx, {}, 0xC0000000, kAll + 0x30000, 1088, "c0000000 330000 4352 1024x768x32 uga 32"},
      {kBgrx, {}, k4G - kAll + 0x1000, kAll, 1024, "- uga 32"},  // across 4 GiB
      {kBgrx, {}, 0x800000000, kAll, 1024, "- uga 32"},
      {kBgrx, {}, 0, kAll, 1024, "- uga 32"},
      {kBgrx, {}, 0x80000000, kAll - 4, 1024, "- uga 32"},  // rows beyond the buffer
      {kBgrx, {}, 0x80000000, kAll, 1000, "- uga 32"},      // rows narrower than the screen
      {PixelRedGreenBlueReserved8BitPerColor, {}, 0x80000000, kAll, 1024, "- uga 32"},
      {PixelBitMask, {0xF800, 0x07E0, 0x001F, 0}, 0x80000000, kAll, 1024, "- uga 16"},
      {PixelBitMask, {0x7C00, 0x03E0, 0x001F, 0}, 0x80000000, kAll, 1024, "- uga 16"},
      {PixelBltOnly, {}, 0, 0, 1024, "- uga 0"},
  };
  for (const Row &row : rows) {
    EFI_GRAPHICS_OUTPUT_MODE_INFORMATION info = {0, 1024, 768, row.format, row.masks, row.scanLine};
    EFI_GRAPHICS_OUTPUT_PROTOCOL_MODE mode = {1, 0, &info, sizeof(info), row.base, row.size};
    EFI_GRAPHICS_OUTPUT_PROTOCOL graphics = {};
    graphics.Mode = &mode;
    PlatformUgaDraw uga;
    PlatformFrameBufferInfo buffer;
    GraphicsInit(&uga, &buffer, &graphics);
    EFI_PHYSICAL_ADDRESS base = 7;
    UINT32 f[6] = {7, 7, 7, 7, 7, 7};  // size, row bytes, width, height, depth, refresh
    std::ostringstream out;
    out << std::hex;
    if (buffer.protocol.GetInfo(&buffer.protocol, &base, &f[0], &f[1], &f[2], &f[3], &f[4]) == EFI_SUCCESS) {
      out << base << ' ' << f[0] << std::dec << ' ' << f[1] << ' ' << f[2] << 'x' << f[3] << 'x' << f[4];
    } else {
      out << (base == 7 && f[0] == 7 && f[1] == 7 && f[4] == 7 ? "-" : "written");
    }
    uga.protocol.GetMode(&uga.protocol, &f[2], &f[3], &f[4], &f[5]);
    EXPECT_EQ(out.str() + " uga " + std::to_string(f[4]), row.facts) << "row " << &row - rows.data();
  }
}

// --- held keys from the keyboard ---------------------------------------------------------

// A keyboard that gives its readings in turn (the last one over and over
// with `endless`, else EFI_NOT_READY without a shift state) and records the
// toggle states set.
struct Keyboard {
  EFI_SIMPLE_TEXT_INPUT_EX_PROTOCOL protocol = {};
  std::vector<std::pair<EFI_STATUS, EFI_KEY_DATA>> readings;
  bool endless;
  EFI_STATUS setState;
  size_t calls = 0;
  std::string states;
};
Keyboard *gKeyboard;

EFI_STATUS EFIAPI FakeReadKeyStrokeEx(EFI_SIMPLE_TEXT_INPUT_EX_PROTOCOL *, EFI_KEY_DATA *data) {
  Keyboard &k = *gKeyboard;
  const size_t at = k.endless ? std::min(k.calls, k.readings.size() - 1) : k.calls;
  k.calls++;
  *data = at < k.readings.size() ? k.readings[at].second : EFI_KEY_DATA{};
  return at < k.readings.size() ? k.readings[at].first : EFI_NOT_READY;
}

EFI_STATUS EFIAPI FakeSetState(EFI_SIMPLE_TEXT_INPUT_EX_PROTOCOL *, EFI_KEY_TOGGLE_STATE *state) {
  gKeyboard->states += Hex(state, 1) + " ";
  return gKeyboard->setState;
}

TEST(PlatformKeys, HeldKeysFromTheFirmwaresKeyboard) {
  constexpr UINT32 kValid = EFI_SHIFT_STATE_VALID;
  auto key = [](UINT16 scan, CHAR16 c, UINT32 shift = 0, UINT8 toggle = 0) {
    return std::make_pair(EFI_SUCCESS, EFI_KEY_DATA{{scan, c}, {shift, toggle}});
  };
  auto now = [](UINT32 shift, UINT8 toggle = 0) {
    return std::make_pair(EFI_NOT_READY, EFI_KEY_DATA{{0, 0}, {shift, toggle}});
  };
  struct Row {
    std::vector<std::pair<EFI_STATUS, EFI_KEY_DATA>> readings;
    const char *held;  // modifiers, keys; then the toggle states set
    bool endless = false;
    EFI_STATUS setState = EFI_SUCCESS;
  };
  const std::vector<Row> rows = {
      // Shift alone as a partial keystroke, Num Lock kept; or only in the state.
      {{now(kValid, 0x82), key(0, 0, kValid | EFI_LEFT_SHIFT_PRESSED)}, "02 | c2 82 "},
      {{now(kValid | EFI_RIGHT_SHIFT_PRESSED)}, "20 | c0 80 "},
      {{key(0, 'v', kValid | EFI_LEFT_LOGO_PRESSED), key(0, 'v', kValid | EFI_LEFT_LOGO_PRESSED)},
       "08 7019 | c0 80 "},
      {{key(0, 0, kValid | EFI_LEFT_SHIFT_PRESSED), now(kValid)},
       "00 | c0 80 "},  // let go: the latest state wins
      {{now(kValid | 0xFF), key(0, 'S', EFI_LEFT_LOGO_PRESSED), key(0, 0x13)},
       "ff 7016 | c0 80 "},  // not valid
      {{key(0, '!'), key(0, '\r'), key(0, 0x16, kValid | EFI_RIGHT_CONTROL_PRESSED), key(0, 0x7F),
        key(0x17, 0), key(0x01, 0), key(0x16, 0), key(0x18, 0), key(0, '/')},
       "10 701e 7028 7019 7029 7052 7045 7038 | c0 80 "},
      {{key(0, 'a')}, "00 7004 | c0 ", true, EFI_UNSUPPORTED},  // never runs dry; partial keys refused
  };
  for (const Row &row : rows) {
    hostfw::Firmware firmware;
    gST = firmware.SystemTable();
    gBS = firmware.BootServices();
    Keyboard keyboard = {{}, row.readings, row.endless, row.setState};
    gKeyboard = &keyboard;
    keyboard.protocol.ReadKeyStrokeEx = FakeReadKeyStrokeEx;
    keyboard.protocol.SetState = FakeSetState;
    gST->ConsoleInHandle = firmware.NewHandle();
    firmware.InstallProtocol(gST->ConsoleInHandle, gEfiSimpleTextInputExProtocolGuid, &keyboard.protocol);
    HeldKeys held = {};
    EXPECT_EQ(KeyStateSample(&held, 50000).exposeState, row.setState);
    std::ostringstream out;
    out << std::hex << std::setfill('0') << std::setw(2) << held.modifiers;
    for (UINT32 i = 0; i < held.count; i++) {
      out << ' ' << held.keys[i];
    }
    EXPECT_EQ(out.str() + " | " + keyboard.states, row.held);
    EXPECT_LE(keyboard.calls, 1 + 6 * 4 * kMaxHeldKeys) << "a bounded number of readings in 50 ms";
  }
  hostfw::Firmware none;
  gST = none.SystemTable();
  gBS = none.BootServices();
  HeldKeys held = {};
  EXPECT_EQ(KeyStateSample(&held, 50000).status, EFI_UNSUPPORTED) << "no keyboard, no wait";
}

// --- the firmware's own protocols ----------------------------------------------------------

// The firmware has a key state protocol of its own, no boot policy: the
// platform keeps the firmware's or puts its own in its place, never beside.
TEST(PlatformProtocols, TheFirmwaresOwnIsKeptOrReplacedInPlace) {
  static std::string heard;
  gOnFirmwareProtocol = [](const char *name, bool replaced) {
    heard += name + std::string(replaced ? "+" : "-");
  };
  for (const bool replace : {false, true}) {
    hostfw::Firmware firmware;
    gBS = firmware.BootServices();
    heard.clear();
    NIMB_KEY_STATE_PROTOCOL theirs = {};
    const EFI_HANDLE handle = firmware.NewHandle();
    firmware.InstallProtocol(handle, gNimbKeyStateProtocolGuid, &theirs);
    PlatformConfig config;
    ConfigSetDefaults(&config);
    config.keysGiven = true;
    config.replaceFirmwareProtocols = replace;
    PlatformKeyState state = {};
    PlatformBootPolicy policy = {};
    KeySample sample;
    ASSERT_EQ(KeyProtocolsInstall(&state, &policy, config, &sample), EFI_SUCCESS);
    EXPECT_EQ(heard, replace ? "key state+" : "key state-");
    UINTN count = 0;
    EFI_HANDLE *handles = nullptr;
    ASSERT_EQ(gBS->LocateHandleBuffer(ByProtocol, &gNimbKeyStateProtocolGuid, nullptr, &count, &handles),
              EFI_SUCCESS);
    EXPECT_EQ(std::vector<EFI_HANDLE>(handles, handles + count), std::vector<EFI_HANDLE>{handle});
    void *found[2] = {};
    gBS->LocateProtocol(&gNimbKeyStateProtocolGuid, nullptr, &found[0]);
    gBS->LocateProtocol(&gNimbBootPolicyProtocolGuid, nullptr, &found[1]);
    EXPECT_EQ(found[0], replace ? static_cast<void *>(&state.protocol) : &theirs);
    EXPECT_EQ(found[1], &policy.protocol);
    EXPECT_EQ(ProtocolsGiveBack(), replace ? 1u : 0u) << "before going back to the firmware";
    gBS->LocateProtocol(&gNimbKeyStateProtocolGuid, nullptr, &found[0]);
    EXPECT_EQ(found[0], &theirs);
  }
  gOnFirmwareProtocol = nullptr;
}

}  // namespace
}  // namespace nimb::platform
