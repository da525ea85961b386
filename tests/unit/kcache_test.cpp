// The kernel cache writer: the file's time, and whole caches (with the key and
// name it gives, prelinked drivers) booted by the loader's LoadKernelCache.
#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <string>
#include <utility>
#include <vector>

#include "kcache/cache_writer.h"
#include "kcache/prelink.h"
#include "kernel_images.h"
#include "load/kernel.h"
#include "load/kernel_cache.h"
#include "loader_fixture.h"
#include "support/devicepath.h"

namespace {

using nimbtest::Bytes;
using nimbtest::Memory;

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
    EXPECT_EQ(std::make_pair(got.tv_sec, got.tv_nsec), std::make_pair(row.want.tv_sec, row.want.tv_nsec))
        << row.name;
  }
}

// --- through the loader ----------------------------------------------------------------

class KcacheBootTest : public nimbtest::VolumeTest {};

// Caches written by the writer into a volume, found, checked and loaded by
// the loader's LoadKernelCache: from a fat kernel, and with prelinked drivers.
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
  Put(extensions + "/A.drvb/Info.plist",
      "<plist version=\"1.0\"><dict><key>VzBundleRequired</key><string>Root</string></dict></plist>");
  strcpy(nimb::gModelName, "Box9,1");
  nimb::gKernelName = u"nimb_kernel";
  const auto *path = reinterpret_cast<const uint8_t *>(fw.DevicePathOf(device_));
  const Bytes pathBytes(path, path + nimb::DevicePathSize(fw.DevicePathOf(device_)));
  const kcache::CacheKey key = kcache::MakeCacheKey("Box9,1", pathBytes, "nimb_kernel");
  std::string loaderName = kcache::CacheFileName(key);
  std::replace(loaderName.begin(), loaderName.end(), '/', '\\');

  const struct {
    const char *name;
    bool compressed, drivers;
  } rows[] = {
      {"fat kernel", true, false},
      {"uncompressed fat kernel", false, false},
      {"prelinked drivers", true, true},
  };
  for (const auto &row : rows) {
    SCOPED_TRACE(row.name);
    Bytes content = fat;
    Put("nimb_kernel", content);
    if (row.drivers) {
      std::vector<kcache::Driver> drivers;
      ASSERT_EQ(kcache::CollectDrivers(dir_->path() + "/" + extensions, &drivers), "");
      ASSERT_EQ(kcache::AddPrelinkSegment(fat, drivers, &content), "");
    }
    Put(kcache::CacheFileName(key), row.compressed ? kcache::WriteCache(content, key, true) : content);
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
