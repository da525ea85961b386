// The kernel cache writer: the key and the name it gives, the header and
// the stream behind it read back with the loader's decoder and checksum, the
// file's time, and prelinked drivers loaded back with the loader's LoadKernel.
#include <gtest/gtest.h>

#include <cstring>
#include <string>
#include <vector>

#include "kcache/cache_writer.h"
#include "kcache/prelink.h"
#include "kernel_images.h"
#include "load/bootfile.h"
#include "load/kernel.h"
#include "load/lzss.h"
#include "loader_fixture.h"
#include "support/checksum.h"

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

TEST(KcacheTest, KeyAsTheLoaderFillsIt) {
  struct Row {
    const char *name;
    std::string model;
    size_t pathSize;
    std::string kernelName;
    std::string nameInKey;  // what of the name fits, its terminator included
  };
  const std::string nul(1, '\0');
  const Row rows[] = {
      {"plain", "Box9,1", 24, "nimb_kernel", "nimb_kernel" + nul},
      {"64-byte model", std::string(64, 'M'), 24, "k", "k" + nul},
      {"model cut at 64", std::string(70, 'M'), 24, "k", "k" + nul},
      {"250-byte path", "Box", 250, "nimb_kernel", "nimb_" + nul},
      {"255-byte path", "Box", 255, "nimb_kernel", nul},
      {"256-byte path", "Box", 256, "nimb_kernel", ""},
      {"path cut at 256", "Box", 300, "nimb_kernel", ""},
      {"two-byte characters", "Box", 24, "k\xC3\xA9rnel", "k\xC3\xA9rnel" + nul},
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

    // The name's suffix: the standard checksum with its bytes reversed.
    uint32_t a = 1, b = 0;
    for (uint8_t byte : want) {
      a = (a + byte) % 65521;
      b = (b + a) % 65521;
    }
    char suffix[9];
    std::snprintf(suffix, sizeof suffix, "%08X", __builtin_bswap32(b << 16 | a));
    EXPECT_EQ(kcache::CacheFileName(key),
              std::string("System/Library/Caches/com.quill.kernelcaches/kernelcache.") + suffix)
        << row.name;
  }
}

TEST(KcacheTest, DevicePathsThatAreNotOne) {
  const struct {
    Bytes path;
    bool good;
  } rows[] = {
      {DevicePath(24), true},
      {{0x7F, 0xFF, 0x04, 0x00}, true},
      {{0xFF, 0xFF, 0x04, 0x00}, true},
      {{0x7F, 0x01, 0x04, 0x00}, false},  // the end of an instance only
      {{0x04, 0x03, 0x02, 0x00, 0x7F, 0xFF, 0x04, 0x00}, false},
      {{0x04, 0x03, 0x40, 0x00, 0x7F, 0xFF, 0x04, 0x00}, false},
      {{0x7F, 0xFF, 0x04, 0x00, 0x00}, false},
      {{}, false},
  };
  for (const auto &row : rows)
    EXPECT_EQ(kcache::CheckDevicePath(row.path).empty(), row.good) << testing::PrintToString(row.path);
}

uint32_t GetBe32(const Bytes &bytes, size_t at) {
  return static_cast<uint32_t>(bytes[at]) << 24 | bytes[at + 1] << 16 | bytes[at + 2] << 8 | bytes[at + 3];
}

TEST(KcacheTest, HeaderAndStreamReadBackWithTheLoadersCode) {
  Bytes kernel = nimbtest::Pattern(70000);
  kernel.insert(kernel.end(), 9000, 0);
  const kcache::CacheKey key = kcache::MakeCacheKey("Box9,1", DevicePath(30), "nimb_kernel");
  for (bool match : {true, false}) {
    const Bytes file = kcache::WriteCache(kernel, key, match);
    ASSERT_GT(file.size(), 384u);
    EXPECT_EQ(std::string(file.begin(), file.begin() + 8), "complzss");
    EXPECT_EQ(GetBe32(file, 12), kernel.size());
    EXPECT_EQ(GetBe32(file, 16), file.size() - 384);
    const Bytes fields(file.begin() + 64, file.begin() + 384);
    EXPECT_EQ(fields, match ? Bytes(key.begin(), key.end()) : Bytes(320, 0));

    Bytes out(kernel.size());
    EXPECT_EQ(nimb::DecompressLzss(out.data(), out.size(), file.data() + 384, GetBe32(file, 16)),
              kernel.size());
    EXPECT_EQ(out, kernel);
    const uint32_t sum = nimb::Adler32(out.data(), out.size());
    EXPECT_EQ(std::memcmp(&file[8], &sum, 4), 0);
  }
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

class PrelinkTest : public nimbtest::LoaderTest {
 protected:
  // Bytes of the host firmware's memory, at their physical address.
  static Bytes Memory(uint64_t address, uint64_t size) {
    const auto *at = reinterpret_cast<const uint8_t *>(static_cast<uintptr_t>(address));
    return Bytes(at, at + size);
  }
};

std::string Plist(const std::string &entries) {
  return "<?xml version=\"1.0\"?>\n<plist version=\"1.0\">\n<dict>\n" + entries + "</dict>\n</plist>\n";
}

std::string Required(const std::string &value) {
  return "<key>VzBundleRequired</key><string>" + value + "</string>\n";
}

TEST_F(PrelinkTest, KeptBundlesLandBehindTheKernel) {
  using nimbtest::Object;
  const Bytes code = nimbtest::Pattern(5000, 3);
  const Bytes fatCode =
      nimbtest::Fat(true, {{18, 0x1000, 100}, {7, 0x2000, 5000}}, {{0x1000, Bytes(100, 1)}, {0x2000, code}});
  nimbtest::TempDir extensions;
  const std::string a = Plist(Required("Root") + "<key>VzBundleExecutable</key><string>A</string>\n");
  extensions.File("A.drvb/Contents/Info.plist", a);
  extensions.File("A.drvb/Contents/Tarnix/A", fatCode);
  const std::string b = Plist(Required(""));
  extensions.File("B.drvb/Info.plist", b);
  extensions.File("C.drvb/Info.plist", Plist(Required("Safe Boot")));
  const std::string d = Plist(Required("Network") + "<key>VzBundleExecutable</key><string>D</string>\n");
  extensions.File("C.drvb/PlugIns/D.drvb/Info.plist", d);
  extensions.File("C.drvb/PlugIns/D.drvb/D", "");
  extensions.File("C.drvb/PlugIns/D.drvb/PlugIns/E.drvb/Info.plist", Plist(Required("Root")));
  extensions.File("F.drvb/Info.plist", Plist("<key>VzBundleRequired</key><integer>1</integer>\n"));
  extensions.File("G.drvb/Info.plist",
                  Plist(Required("Root") + "<key>VzBundleExecutable</key><string>gone</string>\n"));
  extensions.File("H.drvb2/Info.plist", Plist(Required("Root")));
  extensions.File("x.drvb", Plist(Required("Root")));

  std::vector<kcache::Driver> drivers;
  ASSERT_EQ(kcache::CollectDrivers(extensions.path(), &drivers), "");
  // A with its code's x86 slice, B without code, D with an empty code file.
  ASSERT_EQ(drivers.size(), 3u);
  const std::string texts[] = {a, b, d};
  const Bytes codes[] = {code, {}, {}};

  // The kernel's data right behind its commands (the drivers' command moves
  // it back a page), or on a page of its own.
  for (bool roomy : {true, false}) {
    Object object;
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
    const Bytes segment = Memory(base, nimb::gKernelRegionTop - base);
    EXPECT_EQ(nimbtest::GetLe32(segment, 0), nimb::kPrelinkMagic);
    EXPECT_EQ(nimbtest::GetLe32(segment, 4), 3u);
    size_t block = 0x1000;
    for (size_t i = 0; i < 3; i++) {
      const uint32_t length = nimbtest::GetLe32(segment, block + 4);
      EXPECT_EQ(nimbtest::GetLe32(segment, block), base + block + 16) << i;
      EXPECT_EQ(length, texts[i].size() + 1) << i;
      EXPECT_EQ(nimbtest::GetLe32(segment, block + 8), codes[i].empty() ? 0 : base + block + 16 + length)
          << i;
      EXPECT_EQ(nimbtest::GetLe32(segment, block + 12), codes[i].size()) << i;
      EXPECT_EQ(std::string(segment.begin() + block + 16, segment.begin() + block + 16 + length),
                texts[i] + '\0');
      EXPECT_EQ(Bytes(segment.begin() + block + 16 + length,
                      segment.begin() + block + 16 + length + codes[i].size()),
                codes[i]);
      block = (block + 16 + length + codes[i].size() + 0xFFF) & ~size_t{0xFFF};
    }
    EXPECT_EQ(base + block, nimb::gKernelRegionTop);
    nimb::TrackedFreeAll();
    nimb::gKernelRegionBase = 0xFFFFFFFF;
    nimb::gKernelRegionTop = 0;
  }
}

}  // namespace
