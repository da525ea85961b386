// The platform layer's readers of what a user's stick or the firmware
// gives it: arbitrary bytes as platform.cfg, as the table of exact file
// times and as an SMBIOS table, each in a buffer of exactly its size (the
// two texts with the one byte behind them that their parsers may write).
// Every string a report or the configuration gets must lie inside the text,
// and a report's echo must stay printable and inside its room.

#include <cstring>
#include <vector>

#include "fuzz_firmware.h"
#include "platform/config.h"
#include "platform/file_times.h"
#include "platform/machine.h"

namespace np = nimb::platform;

struct Text {
  std::vector<char> bytes;
  Text(const uint8_t *data, size_t size) : bytes(data, data + size) { bytes.push_back('\0'); }
  bool Holds(const char *p) const {
    return p == nullptr || (p >= bytes.data() && p < bytes.data() + bytes.size());
  }
};

void Report(const np::ConfigIssue &issue, void *context) {
  const Text &text = *static_cast<const Text *>(context);
  Check(text.Holds(issue.key) && text.Holds(issue.value));
  for (const char *field : {issue.key, issue.value}) {
    if (field == nullptr)
      continue;
    char echo[np::kConfigEchoCapacity];
    np::ConfigEcho(field, echo, sizeof echo);
    const size_t length = strnlen(echo, sizeof echo);
    Check(length < sizeof echo);
    for (size_t i = 0; i < length; i++)
      Check(echo[i] >= 0x20 && echo[i] < 0x7F);
  }
}

void ParseConfig(const uint8_t *data, size_t size) {
  Text text(data, size);
  np::PlatformConfig config;
  np::ConfigSetDefaults(&config);
  np::ConfigParse(text.bytes.data(), size, &config, Report, &text);
  Check(text.Holds(config.options) && text.Holds(config.timedReadPath));
  Check(config.keys.count <= np::kMaxHeldKeys && config.nvram.count <= np::kMaxConfigEntries &&
        config.dataHub.count <= np::kMaxConfigEntries);
  for (const np::ConfigEntryList *list : {&config.nvram, &config.dataHub})
    for (uint32_t i = 0; i < list->count; i++)
      Check(
          text.Holds(list->entries[i].name) &&
          (list->entries[i].size == 0 ||
           (text.Holds(reinterpret_cast<const char *>(list->entries[i].bytes)) &&
            text.Holds(reinterpret_cast<const char *>(list->entries[i].bytes) + list->entries[i].size - 1))));
}

void ParseTimes(const uint8_t *data, size_t size) {
  Text text(data, size);
  np::FileTimeTable table = {nullptr, 0, np::FileTimesCapacity(text.bytes.data(), size)};
  std::vector<np::FileTimeEntry> entries(table.capacity + 1);
  table.entries = entries.data();
  np::FileTimesParse(text.bytes.data(), size, &table);
  Check(table.count <= table.capacity);
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  ParseConfig(data, size);
  ParseTimes(data, size);
  std::vector<uint8_t> smbios(data, data + size);  // exactly the input's size
  np::SmbiosManufacturerIs(smbios.data(), smbios.size(), "QEMU");
  return 0;
}
