// Host tests of the platform layer's answering protocols: the configuration
// keys of the device properties blob and the network boot answers, and the
// size handshake of both protocols as the loader drives it.
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "../../platform/config.h"
#include "../../platform/device_properties.h"
#include "../../platform/net_boot_info.h"

namespace nimb::platform {
namespace {

struct Parsed {
  std::vector<char> buffer;
  PlatformConfig config;
  UINT32 errors;
  explicit Parsed(const std::string &text) : buffer(text.begin(), text.end()) {
    buffer.push_back('\x7f');
    ConfigSetDefaults(&config);
    errors = ConfigParse(
        buffer.data(), text.size(), &config, [](const ConfigIssue &, void *) {}, nullptr);
  }
};

// A blob's bytes; "absent" when the configuration gives none.
std::string BytesOf(const ConfigBytes &bytes) {
  if (bytes.bytes == nullptr) {
    return "absent";
  }
  return std::string(reinterpret_cast<const char *>(bytes.bytes), bytes.size);
}

// `size` bytes that differ from their neighbours, and their hexadecimal.
std::string Pattern(size_t size) {
  std::string bytes;
  for (size_t i = 0; i < size; i++) {
    bytes.push_back(static_cast<char>(i * 7 + i / 256));
  }
  return bytes;
}

std::string Hex(const std::string &bytes, const char *separator) {
  std::string text;
  for (const char c : bytes) {
    static const char kDigits[] = "0123456789abcdef";
    text += kDigits[static_cast<UINT8>(c) >> 4];
    text += kDigits[static_cast<UINT8>(c) & 0xF];
    text += separator;
  }
  return text;
}

const std::string kAbsent = "absent";

TEST(PlatformAnswerConfig, ParsesBlobAndAnswers) {
  struct Row {
    const char *name;
    std::string text;
    UINT32 errors;
    std::string properties;
    std::string dhcp;
    std::string bsdp;
  };
  const std::string big = Pattern(12000);
  const std::vector<Row> rows = {
      {"nothing given", "", 0, kAbsent, kAbsent, kAbsent},
      {"each key to its own field",
       "device-properties-hex=01\nnetboot.dhcp-hex=0203\nnetboot.bsdp-hex=040506", 0, "\x01", "\x02\x03",
       "\x04\x05\x06"},
      {"empty values are given, not absent", "device-properties-hex=\nnetboot.bsdp-hex=", 0, "", kAbsent, ""},
      {"blanks between bytes, both cases", "netboot.dhcp-hex= aB\tcd  EF ", 0, kAbsent, "\xAB\xCD\xEF",
       kAbsent},
      {"later line wins", "netboot.dhcp-hex=01\nnetboot.dhcp-hex=0203", 0, kAbsent, "\x02\x03", kAbsent},
      {"a refused line keeps the earlier value", "device-properties-hex=0a\ndevice-properties-hex=0g", 1,
       "\x0A", kAbsent, kAbsent},
      {"odd digit count", "netboot.bsdp-hex=123", 1, kAbsent, kAbsent, kAbsent},
      {"digits split by a blank", "device-properties-hex=0 1", 1, kAbsent, kAbsent, kAbsent},
      {"text is not hexadecimal", "netboot.dhcp-hex=hello", 1, kAbsent, kAbsent, kAbsent},
      {"other netboot names are unknown", "netboot.dhcp=01\nnetboot.hex=01", 0, kAbsent, kAbsent, kAbsent},
      {"a blob of several KiB", "device-properties-hex=" + Hex(big, ""), 0, big, kAbsent, kAbsent},
      {"a blob of several KiB with blanks", "device-properties-hex=" + Hex(big, " "), 0, big, kAbsent,
       kAbsent},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(row.name);
    const Parsed parsed(row.text);
    EXPECT_EQ(parsed.errors, row.errors);
    EXPECT_EQ(BytesOf(parsed.config.deviceProperties), row.properties);
    EXPECT_EQ(BytesOf(parsed.config.dhcpResponse), row.dhcp);
    EXPECT_EQ(BytesOf(parsed.config.bsdpResponse), row.bsdp);
  }
}

// --- the size handshake ------------------------------------------------------------

// One call of either protocol: an answer of `given` bytes (-1: absent), the
// room passed in and whether a buffer comes with it.
struct CallRow {
  const char *name;
  int given;
  UINT32 room;
  bool buffer;
  EFI_STATUS status;
  UINT32 size;  // passed out
  bool copied;  // the answer stands at the buffer's start
};

const std::vector<CallRow> kCallRows = {
    {"asking the size", 300, 0, false, EFI_BUFFER_TOO_SMALL, 300, false},
    {"one byte short", 300, 299, true, EFI_BUFFER_TOO_SMALL, 300, false},
    {"exactly the size", 300, 300, true, EFI_SUCCESS, 300, true},
    {"more room than needed gives the size", 300, 4096, true, EFI_SUCCESS, 300, true},
    {"over the loader's first buffer", 5000, 4096, true, EFI_BUFFER_TOO_SMALL, 5000, false},
    {"the retry with the size asked for", 5000, 5000, true, EFI_SUCCESS, 5000, true},
    {"empty answer, size asked", 0, 0, false, EFI_SUCCESS, 0, false},
    {"empty answer into a buffer", 0, 16, true, EFI_SUCCESS, 0, false},
    {"room without a buffer", 300, 300, false, EFI_INVALID_PARAMETER, 300, false},
    {"absent answer, size untouched", -1, 0, false, EFI_NOT_FOUND, 0, false},
    {"absent answer with a buffer", -1, 64, true, EFI_NOT_FOUND, 64, false},
};

constexpr UINT8 kUnwritten = 0xEE;

// Checks a call's outcome; `buffer` has a guard byte behind the room.
void ExpectCall(const CallRow &row, EFI_STATUS status, UINT64 size, const std::vector<UINT8> &buffer,
                const std::string &answer) {
  EXPECT_EQ(status, row.status);
  EXPECT_EQ(size, row.size);
  size_t untouched = 0;
  if (row.copied) {
    ASSERT_GE(buffer.size(), answer.size());
    EXPECT_EQ(std::string(buffer.begin(), buffer.begin() + static_cast<long>(answer.size())), answer);
    untouched = answer.size();
  }
  for (size_t i = untouched; i < buffer.size(); i++) {
    ASSERT_EQ(buffer[i], kUnwritten) << "wrote byte " << i;
  }
}

std::string ConfigLine(const char *key, const CallRow &row, std::string *answer) {
  if (row.given < 0) {
    return "";
  }
  *answer = Pattern(static_cast<size_t>(row.given));
  return std::string(key) + "=" + Hex(*answer, "") + "\n";
}

TEST(PlatformDeviceProperties, AnswersTheSizeHandshake) {
  for (const CallRow &row : kCallRows) {
    if (row.given < 0) {
      continue;  // the protocol isn't there without a blob
    }
    SCOPED_TRACE(row.name);
    std::string blob;
    const Parsed parsed(ConfigLine("device-properties-hex", row, &blob));
    ASSERT_EQ(parsed.errors, 0u);
    PlatformDeviceProperties properties;
    DevicePropertiesInit(&properties, parsed.config.deviceProperties);
    std::vector<UINT8> buffer(row.room + 1, kUnwritten);
    UINT32 size = row.room;
    const EFI_STATUS status =
        properties.protocol.GetProperties(&properties.protocol, row.buffer ? buffer.data() : nullptr, &size);
    ExpectCall(row, status, size, buffer, blob);
  }
}

TEST(PlatformNetBootInfo, AnswersTheSizeHandshakeForEachAnswer) {
  using Entry = decltype(NIMB_NET_BOOT_INFO_PROTOCOL::GetDhcpResponse) NIMB_NET_BOOT_INFO_PROTOCOL::*;
  // The other answer is always there and must never come back instead.
  const struct {
    const char *key;
    Entry entry;
    const char *other;
  } kEntries[] = {
      {"netboot.dhcp-hex", &NIMB_NET_BOOT_INFO_PROTOCOL::GetDhcpResponse, "netboot.bsdp-hex=ffff\n"},
      {"netboot.bsdp-hex", &NIMB_NET_BOOT_INFO_PROTOCOL::GetBsdpResponse, "netboot.dhcp-hex=ffff\n"},
  };
  for (const auto &entry : kEntries) {
    for (const CallRow &row : kCallRows) {
      SCOPED_TRACE(std::string(entry.key) + ": " + row.name);
      std::string answer;
      const Parsed parsed(entry.other + ConfigLine(entry.key, row, &answer));
      ASSERT_EQ(parsed.errors, 0u);
      PlatformNetBootInfo info;
      NetBootInfoInit(&info, parsed.config.dhcpResponse, parsed.config.bsdpResponse);
      std::vector<UINT8> buffer(row.room + 1, kUnwritten);
      UINTN size = row.room;
      const EFI_STATUS status =
          (info.protocol.*(entry.entry))(&info.protocol, &size, row.buffer ? buffer.data() : nullptr);
      ExpectCall(row, status, size, buffer, answer);
    }
  }
}

// --- as the loader drives them -------------------------------------------------------

struct Heard {
  std::string answer;
  UINT64 room;
  EFI_STATUS status;
  UINT64 size;
  bool operator==(const Heard &other) const {
    return answer == other.answer && room == other.room && status == other.status && size == other.size;
  }
};

std::vector<Heard> gHeard;

TEST(PlatformDeviceProperties, DeliversAnyBlobToTheLoadersLoop) {
  struct Row {
    size_t size;
    std::vector<Heard> calls;
  };
  const std::vector<Row> rows = {
      {0, {{"", 4096, EFI_SUCCESS, 0}}},
      {4096, {{"", 4096, EFI_SUCCESS, 4096}}},
      {4097, {{"", 4096, EFI_BUFFER_TOO_SMALL, 4097}, {"", 4097, EFI_SUCCESS, 4097}}},
      {20000, {{"", 4096, EFI_BUFFER_TOO_SMALL, 20000}, {"", 20000, EFI_SUCCESS, 20000}}},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(row.size);
    const std::string blob = Pattern(row.size);
    const Parsed parsed("device-properties-hex=" + Hex(blob, " "));
    ASSERT_EQ(parsed.errors, 0u);
    PlatformDeviceProperties properties;
    DevicePropertiesInit(&properties, parsed.config.deviceProperties);
    gHeard.clear();
    properties.onGetProperties = [](UINT32 room, EFI_STATUS status, UINT32 size) {
      gHeard.push_back({"", room, status, size});
    };
    // The loader starts with 4096 bytes and takes a new buffer of the size
    // that comes back while the answer is "too small".
    UINT32 size = 4096;
    std::vector<UINT8> buffer;
    EFI_STATUS status = EFI_BUFFER_TOO_SMALL;
    for (int tries = 0; tries < 4 && status == EFI_BUFFER_TOO_SMALL; tries++) {
      buffer.assign(size, kUnwritten);
      status = properties.protocol.GetProperties(&properties.protocol, buffer.data(), &size);
    }
    ASSERT_EQ(status, EFI_SUCCESS);
    EXPECT_EQ(std::string(buffer.begin(), buffer.begin() + size), blob);
    EXPECT_EQ(gHeard, row.calls);
  }
}

TEST(PlatformNetBootInfo, TellsWhichAnswerWasAsked) {
  const Parsed parsed("netboot.dhcp-hex=0102\n");
  PlatformNetBootInfo info;
  NetBootInfoInit(&info, parsed.config.dhcpResponse, parsed.config.bsdpResponse);
  gHeard.clear();
  info.onGetResponse = [](const char *answer, UINTN room, EFI_STATUS status, UINTN size) {
    gHeard.push_back({answer, room, status, size});
  };
  // The loader's order: the size of the first, the first, the size of the
  // second.
  UINTN size = 0;
  info.protocol.GetDhcpResponse(&info.protocol, &size, nullptr);
  UINT8 buffer[2] = {};
  info.protocol.GetDhcpResponse(&info.protocol, &size, buffer);
  size = 0;
  info.protocol.GetBsdpResponse(&info.protocol, &size, nullptr);
  const std::vector<Heard> expected = {
      {"dhcp", 0, EFI_BUFFER_TOO_SMALL, 2},
      {"dhcp", 2, EFI_SUCCESS, 2},
      {"bsdp", 0, EFI_NOT_FOUND, 0},
  };
  EXPECT_EQ(gHeard, expected);
}

}  // namespace
}  // namespace nimb::platform
