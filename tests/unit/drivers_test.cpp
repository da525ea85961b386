// Drivers of a plain kernel: the package decision, the second name, the
// bundle scan with both layouts, the walk of the libraries, the staged
// blocks, and the boot sequence's choice between cache and drivers.
#include "load/drivers.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <functional>
#include <string>
#include <tuple>
#include <vector>

#include "hostfw/network.h"
#include "kernel_images.h"
#include "load/bundles.h"
#include "load/kernel_cache.h"
#include "loader_fixture.h"

namespace {

using nimbtest::Bytes;
using nimbtest::Memory;

constexpr uint64_t kRegionTop = 0x400000;
constexpr char kExtensions[] = "System/Library/Extensions";
constexpr char kPackage[] = "System/Library/Extensions.drvpk";

const int64_t kExtensionsTime = nimbtest::UtcSeconds(2007, 12, 31, 23, 59, 59);

// A property list that asks for its bundle with `required` (an element).
std::string BundleList(const std::string &required, const std::string &more = "") {
  return "<?xml version=\"1.0\"?>\n<plist version=\"1.0\">\n<dict>\n<key>VzBundleRequired</key>" + required +
         more + "\n</dict>\n</plist>\n";
}

// A range of /chosen/memory-map: name, address, length.
using Range = std::tuple<std::string, uint32_t, uint32_t>;

std::string Hex(uint64_t value) {
  char text[32];
  snprintf(text, sizeof(text), "%llx", static_cast<unsigned long long>(value));
  return text;
}

class DriversTest : public nimbtest::VolumeTest {
 protected:
  void SetUp() override {
    VolumeTest::SetUp();
    Fresh();
  }
  // The loader's state of a boot that has just placed its kernel.
  void Fresh() {
    nimb::TrackedFreeAll();
    nimbtest::ResetConfigurationState();
    nimb::DeviceTreeInit();
    nimb::gMemoryMapNode = nimb::DeviceTreeFindNode("/chosen/memory-map", 1);
    nimb::gKernelRegionTop = kRegionTop;
    nimb::gDriverRecords = nimb::gLastDriverRecord = nullptr;
    nimb::gKernelName = u"nimb_kernel";
    nimb::gDriverPackageName = nimb::kDefaultDriverPackageName;
  }
  // Empties the volume's directory.
  void Clear() {
    for (const auto &entry : std::filesystem::directory_iterator(dir_->path()))
      std::filesystem::remove_all(entry.path());
  }
  void SetTime(const std::string &name, int64_t seconds) {
    fw.SetFileTime(dir_->path() + "/" + name, seconds);
  }
  // The ranges of /chosen/memory-map in their order.
  static std::vector<Range> Ranges() {
    std::vector<Range> ranges;
    for (const nimb::DeviceTreeProperty *p = nimb::gMemoryMapNode->properties; p != nullptr; p = p->next) {
      if (std::string(p->name) == "name")
        continue;
      const auto *v = static_cast<const uint8_t *>(p->value);
      Bytes value(v, v + p->length);
      ranges.push_back({p->name, nimbtest::GetLe32(value, 0), nimbtest::GetLe32(value, 4)});
    }
    return ranges;
  }
  // The console's text since `mark`, without dots: those of reading come
  // one by one, and cannot be told from those of the messages.
  std::string Said(size_t mark = 0) const { return NoDots(fw.ConOutText().substr(mark)); }
  static std::string NoDots(std::string text) {
    text.erase(std::remove(text.begin(), text.end(), '.'), text.end());
    return text;
  }
};

TEST_F(DriversTest, ThePackageDecisionRowByRow) {
  // A fat package places its x86 slice alone.
  const Bytes slice = nimbtest::Pattern(0x1234, 3);
  const Bytes package = nimbtest::Fat(true, {{18, 0x1000, 0x10}, {7, 0x2000, uint32_t(slice.size())}},
                                      {{0x1000, Bytes(0x10, 1)}, {0x2000, slice}});
  const Bytes fallback = nimbtest::Pattern(0x900, 4);
  // A fat package whose slice runs past its end: the read comes short.
  const Bytes cutShort = nimbtest::Fat(false, {{7, 0x1000, 0x2000}}, {{0x1000, nimbtest::Pattern(0x800)}});
  const Bytes otherSlice = nimbtest::Fat(false, {{18, 0x1000, 0x100}}, {{0x1000, nimbtest::Pattern(0x100)}});
  enum Outcome { kPackage_, kFallback, kBundles };
  constexpr int kLater = 1, kEarlier = 2, kOld = 4, kNoExtensions = 8, kExtensionsFile = 16, kSafe = 32,
                kCustom = 64, kMissing = 128, kWithFallback = 256, kDirectory = 512, kNoKernel = 1024,
                kCutShort = 2048, kOtherSlice = 4096, kDevicePath = 8192;
  struct Row {
    const char *name;
    int setup;
    Outcome outcome;
    std::string said;  // behind "Loading drivers...\n"
  };
  const std::string loadPackage = "Loading System\\Library\\Extensions.drvpk...\r\n";
  const std::string loadFallback = "Loading nimb_kernel.drvpk...\r\n";
  const Row rows[] = {
      {"one second after the extensions", 0, kPackage_, loadPackage},
      {"two seconds after", kLater, kBundles, ""},
      {"as old as the extensions", kEarlier, kBundles, ""},
      {"no extensions directory, whatever its time", kNoExtensions | kOld, kPackage_, loadPackage},
      {"extensions is a file", kExtensionsFile, kPackage_, loadPackage},
      {"safe mode", kSafe, kBundles, ""},
      {"safe mode without extensions", kSafe | kNoExtensions, kPackage_, loadPackage},
      {"named by the user, older, in safe mode", kCustom | kOld | kSafe, kPackage_, loadPackage},
      {"named by the user and missing: no second name", kCustom | kMissing | kWithFallback, kBundles, ""},
      {"missing: no second name", kMissing | kWithFallback, kBundles, ""},
      {"a directory", kDirectory, kBundles, ""},
      {"no kernel", kNoKernel, kBundles, ""},
      {"cut short: the second name", kCutShort | kWithFallback, kFallback, loadPackage + loadFallback},
      {"cut short, no second name", kCutShort, kBundles,
       loadPackage + loadFallback + "Could not open file 'nimb_kernel.drvpk'\r\n"},
      {"no x86 slice: no second name", kOtherSlice | kWithFallback, kBundles, loadPackage},
      // A device path without LoadFile has no source.
      {"a device path on a disk boot", kDevicePath | kWithFallback, kBundles, loadPackage},
  };
  const std::string bundleList = BundleList("<string>Root</string>");
  Bytes path = hostfw::FilePathNode(u"x");
  const Bytes end = hostfw::EndNode();
  path.insert(path.end(), end.begin(), end.end());
  for (const Row &row : rows) {
    SCOPED_TRACE(row.name);
    Clear();
    Fresh();
    const int on = row.setup;
    if (!(on & kNoKernel))
      Put("nimb_kernel", "k");
    if (on & kExtensionsFile) {
      Put(kExtensions, "a file");
    } else if (!(on & kNoExtensions)) {
      Put(std::string(kExtensions) + "/A.drvb/Info.plist", bundleList);
      SetTime(kExtensions, kExtensionsTime);
    }
    if (on & kDirectory)
      dir_->Directory(std::string(kPackage) + "/x");
    else if (!(on & kMissing))
      Put(kPackage, on & kCutShort ? cutShort : on & kOtherSlice ? otherSlice : package);
    SetTime(kPackage, on & kOld ? 0 : kExtensionsTime + 1 + (on & kLater ? 1 : 0) - (on & kEarlier ? 1 : 0));
    if (on & kWithFallback)
      Put("nimb_kernel.drvpk", fallback);
    nimb::gCustomDriverPackage = (on & kCustom) != 0;
    nimb::gBootFlags = on & kSafe ? nimb::kBootSafeMode : 0;
    if (on & kDevicePath)
      nimb::gDriverPackagePath =
          reinterpret_cast<EFI_DEVICE_PATH_PROTOCOL *>(const_cast<uint8_t *>(path.data()));

    const size_t mark = fw.ConOutText().size();
    const EFI_STATUS status = nimb::LoadDrivers(nullptr, root_);
    EXPECT_EQ(Said(mark), NoDots("Loading drivers...\r\n" + row.said));
    const std::vector<Range> ranges = Ranges();
    if (row.outcome == kBundles) {
      ASSERT_EQ(ranges.size(), 1u);
      EXPECT_EQ(std::get<0>(ranges[0]).substr(0, 7), "Driver-");
      EXPECT_EQ(status, EFI_SUCCESS);
      continue;
    }
    EXPECT_EQ(status, EFI_SUCCESS);
    const Bytes &placed = row.outcome == kFallback ? fallback : slice;
    // The failed try keeps its pages; the second stacks above them.
    const uint64_t address = row.outcome == kFallback ? kRegionTop + 0x2000 : kRegionTop;
    const std::vector<Range> expected = {
        {"DriversPackage-" + Hex(address), uint32_t(address), uint32_t(placed.size())}};
    EXPECT_EQ(ranges, expected);
    EXPECT_EQ(Memory(address, placed.size()), placed);
    EXPECT_EQ(nimb::gKernelRegionTop, address + ((placed.size() + 0xFFF) & ~0xFFFull));
  }
}

TEST_F(DriversTest, BundlesAreFoundKeptAndStaged) {
  const std::string dir = std::string(kExtensions) + "/";
  // The slice at 4096 of a fat code file, with another processor's behind.
  const Bytes slice = nimbtest::Pattern(8192, 7);
  Put(dir + "A.drvb/Contents/Info.plist",
      BundleList("<string>Root</string>", "<key>VzBundleExecutable</key><string>a</string>"));
  Put(dir + "A.drvb/Contents/Tarnix/a",
      nimbtest::Fat(false, {{7, 4096, 8192}, {18, 12288, 16}}, {{4096, slice}, {12288, Bytes(16, 9)}}));
  // Nested bundles one level down, and no further.
  Put(dir + "A.drvb/Contents/PlugIns/N.drvb/Info.plist", BundleList("<string>Root</string>"));
  Put(dir + "A.drvb/Contents/PlugIns/N.drvb/PlugIns/Deep.drvb/Info.plist",
      BundleList("<string>Root</string>"));
  // Not kept, but its PlugIns are scanned; the list there is 1000 bytes, so
  // the code starts unaligned at +1017.
  Put(dir + "B.drvb/Info.plist", BundleList("<string>Safe Boot</string>"));
  std::string list = BundleList("<string></string>", "<key>VzBundleExecutable</key><string>s</string>");
  list += std::string(1000 - list.size(), ' ');
  const Bytes code = nimbtest::Pattern(300, 8);
  Put(dir + "B.drvb/PlugIns/S.drvb/Info.plist", list);
  Put(dir + "B.drvb/PlugIns/S.drvb/s", code);
  // Kept only with a string; named exactly; directories only.
  Put(dir + "C.drvb/Info.plist", BundleList("<integer>1</integer>"));
  Put(dir + "D.DRVB/Info.plist", BundleList("<string>Root</string>"));
  Put(dir + "E.drvb2/Info.plist", BundleList("<string>Root</string>"));
  Put(dir + "F.drvb", BundleList("<string>Root</string>"));
  Put(dir + ".drvb/Info.plist", BundleList("<string>Root</string>"));
  // Kept but not staged: its code is missing.
  Put(dir + "G.drvb/Info.plist",
      BundleList("<string>Root</string>", "<key>VzBundleExecutable</key><string>gone</string>"));
  dir_->Directory(dir + "H.drvb");  // no property list
  // A fat code file whose slice runs past its end: staged at its declared
  // length, what did not come as zeroes.
  Put(dir + "I.drvb/Info.plist",
      BundleList("<string>Root</string>", "<key>VzBundleExecutable</key><string>i</string>"));
  const Bytes shortSlice = nimbtest::Pattern(0x300, 2);
  Put(dir + "I.drvb/i", nimbtest::Fat(true, {{7, 0x1000, 0x800}}, {{0x1000, shortSlice}}));
  Bytes shortCode = shortSlice;
  shortCode.resize(0x800);

  ASSERT_EQ(nimb::LoadDrivers(nullptr, root_), EFI_SUCCESS);
  EXPECT_EQ(Said(), "Loading drivers\r\n");
  struct Expected {
    std::string listPath;
    Bytes code;
  };
  // In the firmware's order, each nested bundle right behind its parent.
  const Expected expected[] = {
      {dir + ".drvb/Info.plist", {}},
      {dir + "A.drvb/Contents/Info.plist", slice},
      {dir + "A.drvb/Contents/PlugIns/N.drvb/Info.plist", {}},
      {dir + "B.drvb/PlugIns/S.drvb/Info.plist", code},
      {dir + "I.drvb/Info.plist", shortCode},
  };
  const std::vector<Range> ranges = Ranges();
  ASSERT_EQ(ranges.size(), std::size(expected));
  uint64_t address = kRegionTop;
  for (size_t i = 0; i < ranges.size(); i++) {
    SCOPED_TRACE(expected[i].listPath);
    std::ifstream in(dir_->path() + "/" + expected[i].listPath, std::ios::binary);
    Bytes text((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    text.push_back(0);
    const uint64_t total = 16 + text.size() + expected[i].code.size();
    EXPECT_EQ(ranges[i], Range("Driver-" + Hex(address), uint32_t(address), uint32_t(total)));
    const Bytes header = Memory(address, 16);
    const bool hasCode = !expected[i].code.empty();
    EXPECT_EQ(nimbtest::GetLe32(header, 0), address + 16);
    EXPECT_EQ(nimbtest::GetLe32(header, 4), text.size());
    EXPECT_EQ(nimbtest::GetLe32(header, 8), hasCode ? address + 16 + text.size() : 0);
    EXPECT_EQ(nimbtest::GetLe32(header, 12), expected[i].code.size());
    // The raw text, not the parser's cut copy.
    EXPECT_EQ(Memory(address + 16, text.size()), text);
    EXPECT_EQ(Memory(address + 16 + text.size(), expected[i].code.size()), expected[i].code);
    address += (total + 0xFFF) & ~0xFFFull;
  }
  EXPECT_EQ(nimbtest::GetLe32(Memory(std::get<1>(ranges[3]) + 8, 4), 0), std::get<1>(ranges[3]) + 1017);
  EXPECT_EQ(nimb::gKernelRegionTop, address);
}

TEST_F(DriversTest, TheWalkBringsInTheLibrariesOfSelectedRecords) {
  // Records as a scan might leave them: only A selected; C, a library of a
  // library, stands first, so that a second pass must find it.
  struct Spec {
    const char *identifier;
    const char *libraries;  // keys of VzBundleLibraries
    UINT8 state;
    UINT8 after;
  };
  const Spec specs[] = {
      {"com.c", "", 0, 2},
      {"com.a", "<key>com.b</key><string>1.0</string>", 1, 2},
      {"com.b", "<key>com.c</key><string>2.0</string><key>com.none</key><string>1</string>", 0, 2},
      {"com.d", "", 0, 0},
      {"com.b", "", 0, 0},  // only the first of a name is found
  };
  std::vector<std::string> texts;
  std::vector<nimb::DriverRecord> records(std::size(specs));
  for (const Spec &spec : specs) {
    texts.push_back(std::string("<dict><key>VzBundleIdentifier</key><string>") + spec.identifier +
                    "</string><key>VzBundleLibraries</key><dict>" + spec.libraries + "</dict></dict>");
  }
  for (size_t i = 0; i < records.size(); i++) {
    std::string cut = texts[i];
    records[i] = {};
    ASSERT_EQ(nimb::PlistParseDocument(cut.data(), &records[i].dict), EFI_SUCCESS);
    records[i].state = specs[i].state;
    records[i].plistText = texts[i].data();
    records[i].plistLength = texts[i].size() + 1;
    records[i].executablePath = const_cast<CHAR16 *>(u"");
    records[i].next = i + 1 < records.size() ? &records[i + 1] : nullptr;
  }
  nimb::gDriverRecords = &records[0];
  nimb::gLastDriverRecord = &records.back();
  nimb::WalkDriverLibraries();
  for (size_t i = 0; i < records.size(); i++)
    EXPECT_EQ(records[i].state, specs[i].after) << i;
  nimb::StageDrivers(root_);
  const std::vector<Range> ranges = Ranges();
  ASSERT_EQ(ranges.size(), 3u);
  for (size_t i = 0; i < 3; i++)
    EXPECT_EQ(Memory(std::get<1>(ranges[i]) + 16, texts[i].size()), Bytes(texts[i].begin(), texts[i].end()));
}

}  // namespace
