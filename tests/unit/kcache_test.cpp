// The kernel cache writer: the key and the name it gives, the file's time,
// prelinked drivers against the loader's own staging and loaded back with
// its LoadKernel, and whole caches booted by the loader's LoadKernelCache.
#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <string>
#include <vector>

#include "devicetree/devicetree.h"
#include "kcache/cache_writer.h"
#include "kcache/prelink.h"
#include "kernel_images.h"
#include "load/bootfile.h"
#include "load/bundles.h"
#include "load/kernel.h"
#include "load/kernel_cache.h"
#include "loader_fixture.h"
#include "support/devicepath.h"

namespace {

using nimbtest::Bytes;

// A device path of `size` bytes: one vendor node and the end node.
Bytes DevicePath(size_t size) {
  Bytes path(size - 4, 0x5A);
  path[0] = 0x04;
  path[1] = 0x03;
  path[2] = static_cast<uint8_t>(size - 4);
  path[3] = static_cast<uint8_t>((size - 4) >> 8);
  path.insert(path.end(), {0x7F, 0xFF, 0x04, 0x00});
  return path;
}

// The key comes from the loader's own routine (its cuts and the file name
// are tested with it); what the writer adds is the kernel's name in UTF-8,
// taken through UCS-2 as the loader holds it.
TEST(KcacheTest, KeyAndName) {
  struct Row {
    const char *name;
    std::string model;
    size_t pathSize;
    std::string kernelName;
    std::string nameInKey;  // what of the name fits, its terminator included
  };
  const std::string nul(1, '\0');
  const Row rows[] = {
      {"two- and three-byte characters", "Box", 24, "k\xC3\xA9rn\xE2\x82\xACl",
       "k\xC3\xA9rn\xE2\x82\xACl" + nul},
      {"a character that does not fit", "Box", 252, "\xC3\xA9\xC3\xA9", "\xC3\xA9" + nul},
  };
  for (const Row &row : rows) {
    const Bytes path = DevicePath(row.pathSize);
    Bytes want(320, 0);
    std::memcpy(want.data(), row.model.data(), std::min<size_t>(row.model.size(), 64));
    std::memcpy(want.data() + 64, path.data(), std::min<size_t>(path.size(), 256));
    std::memcpy(want.data() + 64 + row.pathSize, row.nameInKey.data(), row.nameInKey.size());
    const kcache::CacheKey key = kcache::MakeCacheKey(row.model, path, row.kernelName);
    EXPECT_EQ(Bytes(key.begin(), key.end()), want) << row.name;
  }
  // The loader's globals are as they were.
  EXPECT_EQ(nimb::gKernelName, nullptr);
  EXPECT_EQ(nimb::gBootDevicePath, nullptr);
  EXPECT_EQ(nimb::gModelName[0], '\0');
}

TEST(KcacheTest, DevicePathsThatAreNotOne) {
  const struct {
    Bytes path;
    bool good;
  } rows[] = {
      {DevicePath(24), true},
      {{0x7F, 0xFF, 0x04, 0x00}, true},
      {{0x7F, 0x01, 0x04, 0x00}, false},  // the end of an instance only
      {{0x04, 0x03, 0x02, 0x00, 0x7F, 0xFF, 0x04, 0x00}, false},
      {{0x7F, 0xFF, 0x04, 0x00, 0x00}, false},
      {{}, false},
  };
  for (const auto &row : rows)
    EXPECT_EQ(kcache::CheckDevicePath(row.path).empty(), row.good) << testing::PrintToString(row.path);
}

TEST(KcacheTest, TimeIsOneSecondAfterTheNewer) {
  const struct {
    const char *name;
    timespec kernel, extensions, want;
  } rows[] = {
      {"kernel newer", {1000, 5}, {999, 7}, {1001, 5}},
      {"extensions newer", {1000, 5}, {1001, 7}, {1002, 7}},
      {"same second: the kernel's nanoseconds", {1000, 5}, {1000, 900}, {1001, 5}},
  };
  for (const auto &row : rows) {
    const timespec got = kcache::CacheTime(row.kernel, row.extensions);
    EXPECT_EQ(got.tv_sec, row.want.tv_sec) << row.name;
    EXPECT_EQ(got.tv_nsec, row.want.tv_nsec) << row.name;
  }
}

// --- prelinked drivers ------------------------------------------------------------------

class PrelinkTest : public nimbtest::VolumeTest {};

// Bytes of the host firmware's memory, at their physical address.
Bytes Memory(uint64_t address, uint64_t size) {
  const auto *at = reinterpret_cast<const uint8_t *>(static_cast<uintptr_t>(address));
  return Bytes(at, at + size);
}

// The drivers' blocks from `block` on, each on pages of its own, up to the
// kernel region's top, as the loader stages them.
void ExpectBlocks(uint64_t block, const std::vector<kcache::Driver> &drivers) {
  for (const kcache::Driver &driver : drivers) {
    const Bytes header = Memory(block, 16);
    const uint32_t length = nimbtest::GetLe32(header, 4);
    EXPECT_EQ(nimbtest::GetLe32(header, 0), block + 16) << driver.bundle;
    EXPECT_EQ(nimbtest::GetLe32(header, 8), driver.code.empty() ? 0 : block + 16 + length) << driver.bundle;
    EXPECT_EQ(nimbtest::GetLe32(header, 12), driver.code.size()) << driver.bundle;
    Bytes text = driver.text;
    text.push_back(0);
    EXPECT_EQ(Memory(block + 16, length), text) << driver.bundle;
    EXPECT_EQ(Memory(block + 16 + length, driver.code.size()), driver.code) << driver.bundle;
    block = (block + 16 + length + driver.code.size() + 0xFFF) & ~uint64_t{0xFFF};
  }
  EXPECT_EQ(block, nimb::gKernelRegionTop);
}

std::string Plist(const std::string &entries) {
  return "<?xml version=\"1.0\"?>\n<plist version=\"1.0\">\n<dict>\n" + entries + "</dict>\n</plist>\n";
}

std::string Required(const std::string &value) {
  return "<key>VzBundleRequired</key><string>" + value + "</string>\n";
}

std::string Executable(const std::string &name) {
  return "<key>VzBundleExecutable</key><string>" + name + "</string>\n";
}

// The bundles that the writer picks are those that the loader's own scan and
// staging take from the same directory, in the same order, with the same
// text and code; in the kernel they lie as the loader would stage them.
TEST_F(PrelinkTest, TheLoadersBundlesLandBehindTheKernel) {
  const std::string dir = "System/Library/Extensions/";
  Put(dir + "A.drvb/Contents/Info.plist", Plist(Required("Root") + Executable("A")));
  Put(dir + "A.drvb/Contents/Tarnix/A",
      nimbtest::Fat(true, {{18, 0x1000, 100}, {7, 0x2000, 5000}},
                    {{0x1000, Bytes(100, 1)}, {0x2000, nimbtest::Pattern(5000, 3)}}));
  Put(dir + "B.drvb/Info.plist", Plist(Required("")));
  Put(dir + "C.drvb/Info.plist", Plist(Required("Safe Boot")));
  Put(dir + "C.drvb/PlugIns/D.drvb/Info.plist", Plist(Required("Network") + Executable("D")));
  Put(dir + "C.drvb/PlugIns/D.drvb/D", "");
  Put(dir + "C.drvb/PlugIns/D.drvb/PlugIns/E.drvb/Info.plist", Plist(Required("Root")));
  Put(dir + "F.drvb/Info.plist", Plist("<key>VzBundleRequired</key><integer>1</integer>\n"));
  Put(dir + "G.drvb/Info.plist", Plist(Required("Root") + Executable("gone")));
  Put(dir + "H.drvb2/Info.plist", Plist(Required("Root")));
  Put(dir + "I.drvb/Info.plist", Plist(Required("Root") + Executable("i")));
  Put(dir + "I.drvb/i", nimbtest::Fat(false, {{7, 0x1000, 0x800}}, {{0x1000, nimbtest::Pattern(0x300, 2)}}));
  Put(dir + "x.drvb", Plist(Required("Root")));
  dir_->Directory(dir + "J.drvb");

  std::vector<kcache::Driver> drivers;
  ASSERT_EQ(kcache::CollectDrivers(dir_->path() + "/" + dir, &drivers), "");
  EXPECT_EQ(drivers.size(), 4u);  // A, B, D and I

  // The loader's blocks, from a region top of its own.
  nimb::DeviceTreeInit();
  nimb::gMemoryMapNode = nimb::DeviceTreeFindNode("/chosen/memory-map", 1);
  nimb::gKernelRegionTop = 0x400000;
  ASSERT_EQ(nimb::ScanDriverBundles(root_, u"System\\Library\\Extensions", 1), EFI_SUCCESS);
  nimb::WalkDriverLibraries();
  nimb::StageDrivers(root_);
  ExpectBlocks(0x400000, drivers);
  nimb::TrackedFreeAll();
  nimb::gKernelRegionBase = 0xFFFFFFFF;
  nimb::gKernelRegionTop = 0;

  // The kernel's data right behind its commands (the drivers' command moves
  // it back a page), or on a page of its own.
  for (bool roomy : {true, false}) {
    nimbtest::Object object;
    object.commands = {nimbtest::Segment(0x100000, 0x2345, 0x1000, 0x1000), nimbtest::Thread(0x100020)};
    object.data = nimbtest::Pattern(0x1000, 5);
    Bytes kernel = object.Build();
    if (!roomy) {
      const uint32_t start = 28 + 56 + 80;
      nimbtest::PutLe32(kernel, 28 + 32, start);
      kernel.erase(kernel.begin() + start, kernel.begin() + 0x1000);
    }
    Bytes prelinked;
    uint32_t base = 0;
    ASSERT_EQ(kcache::AddPrelinkSegment(kernel, drivers, &prelinked, &base), "") << roomy;
    EXPECT_EQ(base, 0x103000u);

    nimb::BootFile file = {};
    file.buffer = prelinked.data();
    file.size = prelinked.size();
    ASSERT_EQ(nimb::LoadKernel(&file), EFI_SUCCESS) << roomy;
    EXPECT_EQ(nimb::gKernelEntry, 0x100020u);
    EXPECT_EQ(Memory(0x100000, 0x1000), object.data) << roomy;
    const Bytes head = Memory(base, 8);
    EXPECT_EQ(nimbtest::GetLe32(head, 0), nimb::kPrelinkMagic);
    EXPECT_EQ(nimbtest::GetLe32(head, 4), drivers.size());
    ExpectBlocks(base + 0x1000, drivers);
    nimb::TrackedFreeAll();
    nimb::gKernelRegionBase = 0xFFFFFFFF;
    nimb::gKernelRegionTop = 0;
  }
}

// --- through the loader ----------------------------------------------------------------

class KcacheBootTest : public nimbtest::VolumeTest {};

// Caches written by the writer into a volume, found, checked and loaded by
// the loader's LoadKernelCache: compressed with and without the fields that
// it compares, uncompressed, from a fat kernel, and with prelinked drivers.
TEST_F(KcacheBootTest, TheLoaderTakesWhatTheWriterWrote) {
  nimbtest::Object object;
  object.commands = {nimbtest::Segment(0x100000, 0x3000, 0x1000, 0x2800), nimbtest::Thread(0x100040)};
  object.data = nimbtest::Pattern(0x2800, 9);
  object.data.insert(object.data.end() - 0x800, 0x800, 0);
  object.data.resize(0x2800);
  const Bytes kernel = object.Build();
  const Bytes fat = nimbtest::Fat(true, {{18, 0x1000, 64}, {7, 0x2000, static_cast<uint32_t>(kernel.size())}},
                                  {{0x1000, Bytes(64, 7)}, {0x2000, kernel}});
  const std::string extensions = "System/Library/Extensions";
  Put(extensions + "/A.drvb/Info.plist", Plist(Required("Root")));
  strcpy(nimb::gModelName, "Box9,1");
  nimb::gKernelName = u"nimb_kernel";
  const auto *path = reinterpret_cast<const uint8_t *>(fw.DevicePathOf(device_));
  const Bytes pathBytes(path, path + nimb::DevicePathSize(fw.DevicePathOf(device_)));
  const kcache::CacheKey key = kcache::MakeCacheKey("Box9,1", pathBytes, "nimb_kernel");
  std::string loaderName = kcache::CacheFileName(key);
  std::replace(loaderName.begin(), loaderName.end(), '/', '\\');

  const struct {
    const char *name;
    bool fatKernel, compressed, matchFields, drivers;
  } rows[] = {
      {"compressed", false, true, true, false},
      {"no fields to compare", false, true, false, false},
      {"uncompressed", false, false, true, false},
      {"fat kernel", true, true, true, false},
      {"uncompressed fat kernel", true, false, true, false},
      {"prelinked drivers", true, true, true, true},
  };
  for (const auto &row : rows) {
    SCOPED_TRACE(row.name);
    Bytes content = row.fatKernel ? fat : kernel;
    Put("nimb_kernel", content);
    if (row.drivers) {
      std::vector<kcache::Driver> drivers;
      ASSERT_EQ(kcache::CollectDrivers(dir_->path() + "/" + extensions, &drivers), "");
      ASSERT_EQ(kcache::AddPrelinkSegment(row.fatKernel ? fat : kernel, drivers, &content), "");
    }
    const Bytes file = row.compressed ? kcache::WriteCache(content, key, row.matchFields) : content;
    if (row.compressed)  // the fields the loader compares, or zeros
      EXPECT_EQ(Bytes(file.begin() + 64, file.begin() + 384),
                row.matchFields ? Bytes(key.begin(), key.end()) : Bytes(320, 0));
    Put(kcache::CacheFileName(key), file);
    ASSERT_EQ(kcache::SetCacheTime(dir_->path() + "/" + kcache::CacheFileName(key),
                                   dir_->path() + "/nimb_kernel", dir_->path() + "/" + extensions),
              "");

    const size_t mark = fw.ConOutText().size();
    ASSERT_EQ(nimb::LoadKernelCache(nullptr, root_), EFI_SUCCESS) << fw.ConOutText().substr(mark);
    // The file's name, then a dot for each chunk read.
    EXPECT_EQ(
        fw.ConOutText().substr(mark).rfind("Looking for kernel cache file '" + loaderName + "'\r\n.", 0), 0u);
    EXPECT_EQ(nimb::gKernelEntry, 0x100040u);
    EXPECT_EQ(Memory(0x100000, 0x2800), object.data);
    // The drivers' segment on the page behind the kernel: its header page and
    // one page for the one bundle.
    EXPECT_EQ(nimb::gKernelRegionTop, row.drivers ? 0x105000u : 0x103000u);
    if (row.drivers) {
      EXPECT_EQ(nimbtest::GetLe32(Memory(0x103000, 8), 0), nimb::kPrelinkMagic);
      EXPECT_EQ(nimbtest::GetLe32(Memory(0x103000, 8), 4), 1u);
    }
    nimb::TrackedFreeAll();
    nimb::gKernelRegionBase = 0xFFFFFFFF;
    nimb::gKernelRegionTop = 0;
    nimb::gKernelEntry = 0;
  }
}

}  // namespace
