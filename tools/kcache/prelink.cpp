#include "kcache/prelink.h"

#include <algorithm>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <system_error>

#include "config/plist.h"
#include "load/bootfile.h"
#include "load/kernel.h"
#include "load/kernel_cache_format.h"
#include "load/kernel_format.h"

namespace kcache {

namespace fs = std::filesystem;

namespace {

constexpr uint32_t kPage = 4096;
// The loader keeps these bits of a segment's address.
constexpr uint32_t kPhysicalMask = 0x3FFFFFFF;

uint64_t PageUp(uint64_t value) {
  return (value + kPage - 1) / kPage * kPage;
}

uint32_t Get32(const std::vector<uint8_t> &bytes, size_t at) {
  uint32_t value;
  std::memcpy(&value, &bytes[at], 4);
  return value;
}

void Put32(std::vector<uint8_t> &bytes, size_t at, uint32_t value) {
  std::memcpy(&bytes[at], &value, 4);
}

bool ReadWhole(const fs::path &path, std::vector<uint8_t> *bytes) {
  std::error_code error;
  if (!fs::is_regular_file(path, error)) {
    return false;
  }
  std::ifstream in(path, std::ios::binary);
  bytes->assign(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
  return !in.bad();
}

// The 32-bit x86 slice of a fat file, or the whole of any other file, found
// by the loader's own code. A slice that runs past the file's end comes with
// zeros for what is missing, as the loader stages it; `cut` tells.
bool Slice(const std::vector<uint8_t> &file, std::vector<uint8_t> *slice, bool *cut) {
  std::vector<uint8_t> copy = file;
  nimb::BootFile memory = {};
  memory.buffer = copy.data();
  memory.size = copy.size();
  uint64_t offset = 0, size = 0;
  if (copy.empty() || nimb::BootFileFindSlice(&memory, &size, &offset) != EFI_SUCCESS) {
    return false;
  }
  const uint64_t start = std::min<uint64_t>(offset, file.size());
  const uint64_t present = std::min<uint64_t>(size, file.size() - start);
  slice->assign(file.begin() + start, file.begin() + start + present);
  slice->resize(size, 0);
  *cut = present != size;
  return true;
}

// What the loader reads of a bundle's property list, read by its own parser.
struct PlistStrings {
  bool required = false;  // VzBundleRequired is a string other than "Safe Boot"
  bool hasExecutable = false;
  std::string executable;  // VzBundleExecutable
};

bool ReadPlist(const std::vector<uint8_t> &text, PlistStrings *strings) {
  std::vector<char> cut(text.begin(), text.end());
  cut.push_back(0);
  nimb::PlistTag *dict = nullptr;
  if (nimb::PlistParseDocument(cut.data(), &dict) != EFI_SUCCESS || dict == nullptr) {
    return false;
  }
  const nimb::PlistTag *required = nimb::PlistFindKey(dict, "VzBundleRequired");
  strings->required = required != nullptr && required->type == nimb::kPlistString &&
                      std::strcmp(required->text, "Safe Boot") != 0;
  const nimb::PlistTag *executable = nimb::PlistFindKey(dict, "VzBundleExecutable");
  if (executable != nullptr && executable->text != nullptr) {
    strings->hasExecutable = true;
    strings->executable = executable->text;
  }
  nimb::PlistFreeTag(dict);
  return true;
}

std::vector<std::string> SortedEntries(const fs::path &directory) {
  std::vector<std::string> names;
  std::error_code error;
  for (fs::directory_iterator it(directory, error), end; !error && it != end; it.increment(error)) {
    names.push_back(it->path().filename().string());
  }
  std::sort(names.begin(), names.end());
  return names;
}

bool EndsInBundleSuffix(const std::string &name) {
  return name.size() >= 5 && name.compare(name.size() - 5, 5, ".drvb") == 0;
}

// One bundle: appended to `drivers` when the loader would stage it.
void TakeBundle(const fs::path &bundle, bool full, std::vector<Driver> *drivers) {
  const fs::path contents = full ? bundle / "Contents" : bundle;
  std::vector<uint8_t> text;
  PlistStrings strings;
  if (!ReadWhole(contents / "Info.plist", &text) || !ReadPlist(text, &strings) || !strings.required) {
    return;
  }
  Driver driver;
  driver.bundle = bundle.string();
  driver.text = text;
  if (strings.hasExecutable) {
    const fs::path code = (full ? contents / "Tarnix" : bundle) / strings.executable;
    std::vector<uint8_t> bytes;
    if (!ReadWhole(code, &bytes)) {
      return;
    }
    bool cut = false;
    if (!bytes.empty() && !Slice(bytes, &driver.code, &cut)) {
      return;
    }
  }
  drivers->push_back(std::move(driver));
}

void Scan(const fs::path &directory, bool recurse, std::vector<Driver> *drivers) {
  for (const std::string &name : SortedEntries(directory)) {
    std::error_code error;
    const fs::path bundle = directory / name;
    if (!EndsInBundleSuffix(name) || !fs::is_directory(bundle, error)) {
      continue;
    }
    const bool full = fs::exists(bundle / "Contents", error);
    TakeBundle(bundle, full, drivers);
    if (recurse) {
      Scan((full ? bundle / "Contents" : bundle) / "PlugIns", false, drivers);
    }
  }
}

}  // namespace

std::string CollectDrivers(const std::string &extensions, std::vector<Driver> *drivers) {
  std::error_code error;
  if (!fs::is_directory(extensions, error)) {
    return extensions + ": not a directory";
  }
  Scan(extensions, true, drivers);
  return "";
}

std::string AddPrelinkSegment(const std::vector<uint8_t> &kernel, const std::vector<Driver> &drivers,
                              std::vector<uint8_t> *object, uint32_t *segmentAddress) {
  std::vector<uint8_t> out;
  bool cut = false;
  if (!Slice(kernel, &out, &cut)) {
    return "no 32-bit x86 kernel object in it";
  }
  if (cut) {
    return "its 32-bit x86 slice runs past the end of the file";
  }
  nimb::ObjectHeader header;
  if (out.size() < sizeof header) {
    return "too short for a kernel object";
  }
  std::memcpy(&header, out.data(), sizeof header);
  const uint64_t commandsEnd = sizeof header + static_cast<uint64_t>(header.commandsSize);
  if (header.magic != nimb::kObjectMagic || commandsEnd > out.size()) {
    return "not a kernel object";
  }

  // The image's top, and where the file's data starts.
  uint64_t top = 0, dataStart = out.size();
  std::vector<size_t> segments;
  size_t at = sizeof header;
  for (uint32_t i = 0; i < header.commandCount; i++) {
    if (at + sizeof(nimb::LoadCommand) > commandsEnd) {
      return "its load commands run past their size";
    }
    const uint32_t length = Get32(out, at + offsetof(nimb::LoadCommand, commandLength));
    if (length < sizeof(nimb::LoadCommand) || at + length > commandsEnd) {
      return "a load command of a wrong length";
    }
    if (Get32(out, at) == nimb::kLoadCommandSegment && length >= sizeof(nimb::SegmentCommand)) {
      segments.push_back(at);
      const uint32_t address = Get32(out, at + offsetof(nimb::SegmentCommand, address)) & kPhysicalMask;
      top = std::max<uint64_t>(
          top, address + uint64_t{Get32(out, at + offsetof(nimb::SegmentCommand, memorySize))});
      if (Get32(out, at + offsetof(nimb::SegmentCommand, fileSize)) != 0) {
        dataStart =
            std::min<uint64_t>(dataStart, Get32(out, at + offsetof(nimb::SegmentCommand, fileOffset)));
      }
    }
    at += length;
  }

  // The segment: its header on the first page, each driver's block on pages
  // of its own from the second on.
  const uint64_t base = PageUp(top);
  std::vector<uint8_t> segment(kPage);
  Put32(segment, offsetof(nimb::PrelinkHeader, magic), nimb::kPrelinkMagic);
  Put32(segment, offsetof(nimb::PrelinkHeader, driverCount), static_cast<uint32_t>(drivers.size()));
  for (const Driver &driver : drivers) {
    const uint64_t block = segment.size();
    const uint64_t plistLength = driver.text.size() + 1;
    segment.resize(PageUp(block + 16 + plistLength + driver.code.size()));
    const uint64_t address = base + block;
    Put32(segment, block, static_cast<uint32_t>(address + 16));
    Put32(segment, block + 4, static_cast<uint32_t>(plistLength));
    Put32(segment, block + 8, driver.code.empty() ? 0 : static_cast<uint32_t>(address + 16 + plistLength));
    Put32(segment, block + 12, static_cast<uint32_t>(driver.code.size()));
    std::copy(driver.text.begin(), driver.text.end(), segment.begin() + block + 16);
    std::copy(driver.code.begin(), driver.code.end(), segment.begin() + block + 16 + plistLength);
  }
  if (base + segment.size() > kPhysicalMask) {
    return "the drivers would lie above the addresses a kernel object can hold";
  }

  // Room for one more command in front of the data; if there is none, the
  // data moves back by a page and the segments' offsets with it.
  if (commandsEnd + sizeof(nimb::SegmentCommand) > dataStart) {
    if (dataStart < commandsEnd) {
      return "a segment's data overlaps the load commands: no room for one more";
    }
    out.insert(out.begin() + commandsEnd, kPage, 0);
    for (size_t command : segments) {
      const size_t field = command + offsetof(nimb::SegmentCommand, fileOffset);
      if (Get32(out, field) >= commandsEnd) {
        Put32(out, field, Get32(out, field) + kPage);
      }
    }
  }
  const uint64_t fileOffset = PageUp(out.size());
  nimb::SegmentCommand command = {};
  command.command = nimb::kLoadCommandSegment;
  command.commandLength = sizeof command;
  std::memcpy(command.segmentName, "__PRELINK", 9);
  command.address = static_cast<uint32_t>(base);
  command.memorySize = static_cast<uint32_t>(segment.size());
  command.fileOffset = static_cast<uint32_t>(fileOffset);
  command.fileSize = static_cast<uint32_t>(segment.size());
  std::memcpy(&out[commandsEnd], &command, sizeof command);
  header.commandCount++;
  header.commandsSize += sizeof command;
  std::memcpy(out.data(), &header, sizeof header);
  out.resize(fileOffset);
  out.insert(out.end(), segment.begin(), segment.end());
  *object = std::move(out);
  if (segmentAddress != nullptr) {
    *segmentAddress = static_cast<uint32_t>(base);
  }
  return "";
}

}  // namespace kcache
