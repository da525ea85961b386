// The kernel cache: the one-second rule with the calendar's carries, the key
// and the file name it gives, and every way a cache is taken or refused (the
// boot's choice between a cache and the plain kernel with drivers is the
// QEMU scenarios').
#include "load/kernel_cache.h"

#include <gtest/gtest.h>

#include <functional>
#include <string>
#include <vector>

#include "hostfw/network.h"
#include "kcache/cache_writer.h"
#include "kernel_images.h"
#include "load/bootfile.h"
#include "loader_fixture.h"

namespace {

using nimbtest::Bytes;
using nimbtest::TrackedPoolBlocks;

struct Date {
  int year, month, day, hour, minute, second;
  uint32_t nanosecond = 0;
};

EFI_FILE_INFO InfoAt(const Date &d) {
  EFI_FILE_INFO info = {};
  info.ModificationTime.Year = static_cast<UINT16>(d.year);
  info.ModificationTime.Month = static_cast<UINT8>(d.month);
  info.ModificationTime.Day = static_cast<UINT8>(d.day);
  info.ModificationTime.Hour = static_cast<UINT8>(d.hour);
  info.ModificationTime.Minute = static_cast<UINT8>(d.minute);
  info.ModificationTime.Second = static_cast<UINT8>(d.second);
  info.ModificationTime.Nanosecond = d.nanosecond;
  info.ModificationTime.TimeZone = 0x7FF;
  return info;
}

int64_t Seconds(const Date &d) {
  return nimbtest::UtcSeconds(d.year, d.month, d.day, d.hour, d.minute, d.second);
}

// A kernel of one page at 0x200000, entered at 0x200010.
Bytes OnePageKernel() {
  return nimbtest::Object{
      0xFEEDFACE,
      {nimbtest::Segment(0x200000, 0x1000, nimbtest::kObjectDataStart, 0x1000), nimbtest::Thread(0x200010)},
      nimbtest::Pattern(0x1000)}
      .Build();
}

TEST(KernelCacheTime, OneSecondLaterWithTheCalendarsCarries) {
  struct Row {
    Date earlier, later;
    bool after;
  };
  const Row rows[] = {
      {{2006, 12, 31, 23, 59, 59}, {2007, 1, 1, 0, 0, 0}, true},
      {{2008, 2, 28, 23, 59, 59}, {2008, 2, 29, 0, 0, 0}, true},
      {{2007, 2, 28, 23, 59, 59}, {2007, 3, 1, 0, 0, 0}, true},
      {{1900, 2, 28, 23, 59, 59}, {1900, 3, 1, 0, 0, 0}, true},
      {{2000, 2, 28, 23, 59, 59}, {2000, 2, 29, 0, 0, 0}, true},
      {{2007, 4, 30, 23, 59, 59}, {2007, 5, 1, 0, 0, 0}, true},
      {{2007, 1, 30, 23, 59, 59}, {2007, 1, 31, 0, 0, 0}, true},
      {{2007, 5, 5, 10, 59, 59}, {2007, 5, 5, 11, 0, 0}, true},
      {{2007, 5, 5, 10, 20, 30}, {2007, 5, 5, 10, 20, 31}, true},
      {{2007, 5, 5, 10, 20, 30}, {2007, 5, 5, 10, 20, 32}, false},
      {{2007, 5, 5, 10, 20, 30}, {2007, 5, 5, 10, 20, 30}, false},
      {{2007, 5, 5, 10, 20, 31}, {2007, 5, 5, 10, 20, 30}, false},
      // All 16 bytes count: a nanosecond apart is no match.
      {{2006, 12, 31, 23, 59, 59, 5}, {2007, 1, 1, 0, 0, 0, 5}, true},
      {{2006, 12, 31, 23, 59, 59}, {2007, 1, 1, 0, 0, 0, 1}, false},
  };
  for (const Row &row : rows) {
    EFI_FILE_INFO earlier = InfoAt(row.earlier), later = InfoAt(row.later);
    EXPECT_EQ(nimb::IsOneSecondAfter(&earlier, &later), row.after) << &row - rows;
  }
}

TEST(KernelCacheTime, TheNewerRecordToTheSecond) {
  struct Row {
    Date a, b;
    bool bIsNewer;
  };
  const Row rows[] = {
      {{2007, 1, 1, 0, 0, 0}, {2006, 12, 31, 23, 59, 59}, false},
      {{2007, 3, 1, 0, 0, 5}, {2007, 3, 1, 0, 0, 6}, true},
      // A tie to the second goes to the first, the nanoseconds aside.
      {{2007, 3, 1, 0, 0, 5, 1}, {2007, 3, 1, 0, 0, 5, 9}, false},
  };
  for (const Row &row : rows) {
    EFI_FILE_INFO a = InfoAt(row.a), b = InfoAt(row.b), out;
    a.FileSize = 1;
    b.FileSize = 2;
    nimb::PickNewerFileInfo(&a, &b, &out);
    EXPECT_EQ(out.FileSize, row.bIsNewer ? 2u : 1u) << &row - rows;
    nimb::PickNewerFileInfo(&a, &b, &a);
    EXPECT_EQ(a.FileSize, row.bIsNewer ? 2u : 1u);
  }
}

class KernelCacheTest : public nimbtest::VolumeTest {
 protected:
  void SetUp() override {
    VolumeTest::SetUp();
    strcpy(nimb::gModelName, "TestBox1,1");
    nimb::gKernelName = u"nimb_kernel";
  }
  // The cache file's name for the key as it stands.
  static std::string CacheName() {
    nimb::MakeKernelCacheKey();
    char digits[9];
    snprintf(
        digits, sizeof(digits), "%08X",
        __builtin_bswap32(nimbtest::ReferenceAdler32(nimb::gKernelCacheKey, sizeof(nimb::gKernelCacheKey))));
    return std::string("System/Library/Caches/com.quill.kernelcaches/kernelcache.") + digits;
  }
};

TEST_F(KernelCacheTest, TheKeyAndTheNameItGives) {
  // A device path of `size` bytes: one file-path node and the end node.
  auto pathOf = [](size_t size) {
    Bytes path = hostfw::FilePathNode(std::u16string((size - 10) / 2, u'p')), end = hostfw::EndNode();
    path.insert(path.end(), end.begin(), end.end());
    return path;
  };
  struct Row {
    const char *name;
    std::string model;  // written into the model's 64 bytes, unterminated when 64 long
    size_t pathBytes;
    std::u16string kernel;
    std::string keptModel;  // of the key
    std::string keptName;   // of the key, behind the path, with its zero
  };
  const std::string m64(64, 'M');
  const std::u16string longName(300, u'k');
  const Row rows[] = {
      {"short model and path", "Box1,1", 40, u"nimb_kernel", "Box1,1", std::string("nimb_kernel") + '\0'},
      {"a model of exactly 64 bytes", m64, 40, u"k", m64, std::string("k") + '\0'},
      {"a path of 250 bytes leaves 6 for the name", "B", 250, u"nimb_kernel", "B",
       std::string("nimb_") + '\0'},
      {"a path of 256 bytes leaves none", "B", 256, u"nimb_kernel", "B", ""},
      {"a longer path is cut at 256", "B", 300, u"nimb_kernel", "B", ""},
      {"a long name is cut", "B", 100, longName, "B", std::string(155, 'k') + '\0'},
      // A character that does not fit is left out whole.
      {"a wide character at the end", "B", 250, u"abcd\u00e9", "B", std::string("abcd") + '\0' + '\0'},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(row.name);
    memset(nimb::gModelName, 0, sizeof(nimb::gModelName));
    memcpy(nimb::gModelName, row.model.data(), row.model.size());
    Bytes path = pathOf(row.pathBytes);
    nimb::gBootDevicePath = reinterpret_cast<EFI_DEVICE_PATH_PROTOCOL *>(path.data());
    nimb::gKernelName = row.kernel.c_str();
    Bytes expected(320, 0);
    std::copy(row.keptModel.begin(), row.keptModel.end(), expected.begin());
    const size_t kept = std::min<size_t>(row.pathBytes, 256);
    std::copy(path.begin(), path.begin() + kept, expected.begin() + 64);
    std::copy(row.keptName.begin(), row.keptName.end(), expected.begin() + 64 + kept);
    nimb::MakeKernelCacheKey();
    EXPECT_EQ(Bytes(nimb::gKernelCacheKey, nimb::gKernelCacheKey + 320), expected);
  }
  nimb::gBootDevicePath = fw.DevicePathOf(device_);
  nimb::gKernelName = u"nimb_kernel";
  strcpy(nimb::gModelName, "TestBox1,1");

  // The name carries the reversed checksum in eight upper-case digits; a
  // name from the configuration takes the place of the default.
  std::string expected = CacheName();
  std::replace(expected.begin(), expected.end(), '/', '\\');
  EXPECT_NE(nimb::LoadKernelCache(nullptr, root_), EFI_SUCCESS);
  EXPECT_EQ(fw.ConOutText(), "Looking for kernel cache file '" + expected + "'\r\n");
  char config[] = "<dict><key>Kernel Cache</key><string>my\\cache</string></dict>";
  ASSERT_EQ(nimb::PlistParseDocument(config, &nimb::gConfigDict), EFI_SUCCESS);
  nimb::LoadKernelCache(nullptr, root_);
  EXPECT_NE(fw.ConOutText().find("'my\\cache." + expected.substr(expected.size() - 8) + "'"),
            std::string::npos);
}

// Caches from the cache writer, spoilt byte by byte: "comp", "lzss", the
// checksum, the sizes, the model and path fields at 64, then the stream.
TEST_F(KernelCacheTest, ACacheIsTakenOnlyWhenEverythingHolds) {
  const Bytes kernel = OnePageKernel();
  const std::string cacheName = CacheName();
  kcache::CacheKey key;
  std::copy(nimb::gKernelCacheKey, nimb::gKernelCacheKey + key.size(), key.begin());
  const Date kernelTime = {2006, 12, 31, 23, 59, 59};

  struct Setup {
    Bytes file;  // the cache file's bytes
    Date kernel, extensions, cacheTime;
    bool extensionsDirectory = true, noExtensions = false, cacheDirectory = false;
    UINT64 flags = 0;
    UINT8 customPackage = 0;
  };
  // Both fields as in the key, but for one byte flipped (0: none).
  auto keyFields = [&](Setup &s, size_t flip) {
    s.file = kcache::WriteCache(kernel, key, true);
    s.file[64 + flip] ^= flip != 0;
  };
  auto size = [&](Setup &s, int delta) { nimbtest::PutBe32(s.file, 12, uint32_t(kernel.size() + delta)); };
  struct Row {
    const char *name;
    std::function<void(Setup &)> change;
    EFI_STATUS status;
  };
  const Row rows[] = {
      {"valid, over the year's end", [](Setup &) {}, EFI_SUCCESS},
      {"model and boot path as in the key", [&](Setup &s) { keyFields(s, 0); }, EFI_SUCCESS},
      {"extensions newer than the kernel count",
       [](Setup &s) {
         s.kernel = {2006, 5, 1, 0, 0, 0};
         s.extensions = {2006, 12, 31, 23, 59, 59};
       },
       EFI_SUCCESS},
      {"an uncompressed plain kernel", [&](Setup &s) { s.file = kernel; }, EFI_SUCCESS},
      {"two seconds after", [](Setup &s) { s.cacheTime = {2007, 1, 1, 0, 0, 1}; }, EFI_NOT_FOUND},
      {"as old as the kernel", [](Setup &s) { s.cacheTime = s.kernel; }, EFI_NOT_FOUND},
      {"one second after the older of the two", [](Setup &s) { s.extensions = {2007, 1, 1, 0, 0, 0}; },
       EFI_NOT_FOUND},
      {"no extensions directory", [](Setup &s) { s.noExtensions = true; }, EFI_NOT_FOUND},
      {"extensions is a file", [](Setup &s) { s.extensionsDirectory = false; }, EFI_NOT_FOUND},
      {"the cache is a directory", [](Setup &s) { s.cacheDirectory = true; }, EFI_NOT_FOUND},
      {"shorter than the header, though a plain kernel",
       [&](Setup &s) { s.file.assign(kernel.begin(), kernel.begin() + 383); }, EFI_NOT_FOUND},
      {"another compression", [](Setup &s) { std::copy_n("lzvn", 4, s.file.begin() + 4); }, EFI_NOT_FOUND},
      {"another model", [&](Setup &s) { keyFields(s, 63); }, EFI_NOT_FOUND},
      {"another boot path", [&](Setup &s) { keyFields(s, 319); }, EFI_NOT_FOUND},
      {"compressed data cut short", [](Setup &s) { s.file.pop_back(); }, EFI_NOT_FOUND},
      {"a wrong checksum", [](Setup &s) { s.file[11] ^= 1; }, EFI_DEVICE_ERROR},
      {"a stream shorter than the size", [&](Setup &s) { size(s, 1); }, EFI_DEVICE_ERROR},
      // The stream stops at the size: what it gives then fails the checksum.
      {"a stream longer than the size", [&](Setup &s) { size(s, -1); }, EFI_DEVICE_ERROR},
      {"safe mode", [](Setup &s) { s.flags = nimb::kBootSafeMode; }, EFI_ACCESS_DENIED},
      {"network", [](Setup &s) { s.flags = nimb::kBootNetwork; }, EFI_ACCESS_DENIED},
      {"another kernel", [](Setup &s) { s.flags = nimb::kBootOtherKernel; }, EFI_ACCESS_DENIED},
      {"a package named by the user", [](Setup &s) { s.customPackage = 1; }, EFI_ACCESS_DENIED},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(row.name);
    nimbtest::TempDir dir;
    Setup s{kcache::WriteCache(kernel, key, false), kernelTime, {2006, 1, 1, 0, 0, 0}, {2007, 1, 1, 0, 0, 0}};
    row.change(s);
    dir.File("nimb_kernel", kernel);
    const std::string extensions = "System/Library/Extensions";
    if (s.extensionsDirectory && !s.noExtensions)
      dir.Directory(extensions);
    if (!s.extensionsDirectory)
      dir.File(extensions, "not a directory");
    if (s.cacheDirectory)
      dir.Directory(cacheName);
    else
      dir.File(cacheName, s.file);
    hostfw::Firmware local;
    nimbtest::AttachTo(local);
    for (const auto &[name, date] : {std::pair<std::string, Date>{"nimb_kernel", s.kernel},
                                     {extensions, s.extensions},
                                     {cacheName, s.cacheTime}})
      local.SetFileTime(dir.path() + "/" + name, Seconds(date));
    EFI_HANDLE device = local.AddDirectoryVolume(dir.path());
    nimb::gBootDevicePath = local.DevicePathOf(device);
    strcpy(nimb::gModelName, "TestBox1,1");
    nimb::gKernelName = u"nimb_kernel";
    nimb::gBootFlags = s.flags;
    nimb::gCustomDriverPackage = s.customPackage;
    EFI_SIMPLE_FILE_SYSTEM_PROTOCOL *fileSystem = nullptr;
    local.BootServices()->HandleProtocol(device, &gEfiSimpleFileSystemProtocolGuid,
                                         reinterpret_cast<void **>(&fileSystem));
    EFI_FILE *root = nullptr;
    ASSERT_EQ(fileSystem->OpenVolume(fileSystem, &root), EFI_SUCCESS);

    EXPECT_EQ(nimb::LoadKernelCache(nullptr, root), row.status);
    EXPECT_EQ(nimb::gKernelEntry, row.status == EFI_SUCCESS ? 0x200010u : 0u);
    EXPECT_EQ(local.AllocatedPages(), row.status == EFI_SUCCESS ? 1u : 0u);
    EXPECT_EQ(TrackedPoolBlocks(), 0u) << "everything but the kernel's pages is given back";
    EXPECT_EQ(local.OpenFiles(), 1u) << "only the root stays open";
    if (row.status == EFI_ACCESS_DENIED) {
      EXPECT_EQ(local.ConOutText(), "");
      EXPECT_TRUE(local.OpenedNames().empty());
    }
    if (row.status == EFI_SUCCESS) {
      // The three records come before any byte of the cache is read.
      const std::vector<std::string> expected = {local.OpenedNames()[0], "nimb_kernel",
                                                 "System\\Library\\Extensions", local.OpenedNames()[0]};
      EXPECT_EQ(local.OpenedNames(), expected);
    }
    nimb::TrackedFreeAll();
  }
  nimbtest::ResetLoaderState();
  Attach();
}

}  // namespace
