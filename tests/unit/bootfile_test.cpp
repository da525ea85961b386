// Reading files: volume files in chunks, the single fetch of a LoadFile
// device, memory records, and reading a whole file.
#include "load/bootfile.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <string>
#include <tuple>
#include <vector>

#include "hostfw/network.h"
#include "kernel_images.h"
#include "loader_fixture.h"
#include "temp_dir.h"

namespace {

using nimb::BootFile;
using nimbtest::Pattern;

class BootFileTest : public nimbtest::VolumeTest {
 protected:
  size_t Dots() const {
    size_t dots = 0;
    for (const std::u16string &call : fw.ConOutCalls())
      dots += call == u".";
    return dots;
  }
};

TEST_F(BootFileTest, VolumeReadsGoInChunksWithADotEach) {
  struct Row {
    size_t fileSize;
    uint64_t request;
    uint64_t expectedCount;
    size_t expectedDots;
  } rows[] = {
      {0x10000, 0x10000, 0x10000, 1},
      {0x10001, 0x10001, 0x10001, 2},
      {0x30000, 0x25000, 0x25000, 3},
      {100, 0, 0, 0},
      // A file that ends early: the firmware's zero-byte answer ends the loop.
      {0x10010, 0x20000, 0x10010, 3},
      {10, 100, 10, 2},
  };
  for (const Row &row : rows) {
    std::vector<uint8_t> bytes = Pattern(row.fileSize);
    Put("f", bytes);
    BootFile file;
    ASSERT_EQ(nimb::BootFileOpen(nullptr, root_, u"f", &file), EFI_SUCCESS);
    uint64_t size = 0;
    ASSERT_EQ(nimb::BootFileGetSize(&file, &size), EFI_SUCCESS);
    EXPECT_EQ(size, row.fileSize);
    size_t dots = Dots();
    std::vector<uint8_t> out(row.request + 1, 0xEE);
    uint64_t count = row.request;
    EXPECT_EQ(nimb::BootFileRead(&file, &count, out.data()), EFI_SUCCESS) << row.request;
    EXPECT_EQ(count, row.expectedCount) << row.request;
    EXPECT_EQ(Dots() - dots, row.expectedDots) << row.request;
    EXPECT_TRUE(std::equal(out.begin(), out.begin() + count, bytes.begin())) << row.request;
    EXPECT_EQ(out[count], 0xEE) << row.request;
    nimb::BootFileClose(&file);
  }
  EXPECT_EQ(fw.OpenFiles(), 1u);  // only the root
}

TEST_F(BootFileTest, ALoadFileRecordFetchesOnce) {
  hostfw::NetworkDevice net(fw);
  std::vector<uint8_t> bytes = Pattern(5000);
  net.PutFile(u"k", bytes);
  BootFile file;
  ASSERT_EQ(nimb::BootFileOpen(net.Protocol(), nullptr, u"k", &file), EFI_SUCCESS);
  EXPECT_TRUE(net.Calls().empty());  // nothing asked at open

  std::vector<uint8_t> out(5000);
  uint64_t count = 8;
  ASSERT_EQ(nimb::BootFileRead(&file, &count, out.data()), EFI_SUCCESS);
  ASSERT_EQ(nimb::BootFileSetPosition(&file, 0), EFI_SUCCESS);
  count = 5000;
  ASSERT_EQ(nimb::BootFileRead(&file, &count, out.data()), EFI_SUCCESS);
  EXPECT_EQ(count, 5000u);
  EXPECT_EQ(out, bytes);
  ASSERT_EQ(net.Calls().size(), 2u);
  EXPECT_FALSE(net.Calls()[0].withBuffer);
  EXPECT_TRUE(net.Calls()[1].withBuffer);
  EXPECT_EQ(net.Calls()[1].bufferSize, 5000u);  // the file's size, not the margin
  EXPECT_EQ(net.Calls()[1].name, u"k");
  // The fetched file is read from memory from here on, within its size.
  EXPECT_EQ(nimb::BootFileSetPosition(&file, 5001), EFI_INVALID_PARAMETER);
  for (UINT64 position : {4990, 5000}) {
    ASSERT_EQ(nimb::BootFileSetPosition(&file, position), EFI_SUCCESS);
    count = 50;
    ASSERT_EQ(nimb::BootFileRead(&file, &count, out.data()), EFI_SUCCESS);
    EXPECT_EQ(count, 5000 - position);
    EXPECT_EQ(out[0], bytes[4990]);
  }
  EXPECT_EQ(net.Calls().size(), 2u);
  nimb::BootFileClose(&file);
  EXPECT_EQ(fw.LivePoolBlocks(), 1u);  // path and buffer gone; the tag block stays
  // A record of the caller's memory keeps it at the close.
  file = {};
  file.buffer = bytes.data();
  file.size = bytes.size();
  nimb::BootFileClose(&file);
  EXPECT_EQ(std::make_tuple(file.buffer, file.size), std::make_tuple(bytes.data(), UINT64{0}));
  BootFile empty = {};
  EXPECT_EQ(nimb::BootFileGetSize(&empty, nullptr), EFI_INVALID_PARAMETER);
  EXPECT_EQ(nimb::BootFileRead(&empty, &count, out.data()), EFI_INVALID_PARAMETER);
}

TEST_F(BootFileTest, LoadFileFailures) {
  hostfw::NetworkDevice net(fw);
  BootFile file;
  ASSERT_EQ(nimb::BootFileOpen(net.Protocol(), nullptr, u"missing", &file), EFI_SUCCESS);
  uint64_t count = 4;
  uint8_t out[16];
  EXPECT_EQ(nimb::BootFileRead(&file, &count, out), EFI_NOT_FOUND);
  nimb::BootFileClose(&file);

  // A device that answers the size query with success: an empty file.
  net.PutFile(u"q", Pattern(10));
  net.AnswerSizeQueryWithSuccess(true);
  ASSERT_EQ(nimb::BootFileOpen(net.Protocol(), nullptr, u"q", &file), EFI_SUCCESS);
  uint64_t size = 99;
  EXPECT_EQ(nimb::BootFileGetSize(&file, &size), EFI_SUCCESS);
  EXPECT_EQ(size, 0u);
  nimb::BootFileClose(&file);
  net.AnswerSizeQueryWithSuccess(false);

  // The fetch delivers another length than the size query gave.
  for (int skew : {-1, 1}) {
    ASSERT_EQ(nimb::BootFileOpen(net.Protocol(), nullptr, u"q", &file), EFI_SUCCESS);
    net.SkewNextFetch(skew);
    hostfw::RunResult result = fw.Call([&] {
      uint64_t n = 4;
      nimb::BootFileRead(&file, &n, out);
    });
    EXPECT_EQ(result.end, hostfw::RunEnd::Exited) << skew;
    EXPECT_EQ(result.status, EFI_ABORTED) << skew;
    EXPECT_NE(fw.ConOutText().find("Network file size mismatch\r\n"), std::string::npos) << skew;
    Attach();
  }
}

TEST_F(BootFileTest, ReadWhole) {
  Put("empty", std::string());
  Put("data", Pattern(70000));
  UINT64 size = 77;
  UINT8 *buffer = reinterpret_cast<UINT8 *>(1);
  size_t pools = fw.LivePoolBlocks();
  ASSERT_EQ(nimb::BootFileReadWhole(nullptr, root_, u"empty", nullptr, &size, &buffer), EFI_SUCCESS);
  EXPECT_EQ(size, 0u);
  EXPECT_EQ(buffer, nullptr);
  EXPECT_LE(fw.LivePoolBlocks(), pools + 1);  // at most the first tag block

  ASSERT_EQ(nimb::BootFileReadWhole(nullptr, root_, u"data", nullptr, &size, &buffer), EFI_SUCCESS);
  EXPECT_EQ(size, 70000u);
  EXPECT_EQ(std::vector<uint8_t>(buffer, buffer + size), Pattern(70000));
  EXPECT_EQ(fw.OpenFiles(), 1u);

  EXPECT_EQ(nimb::BootFileReadWhole(nullptr, root_, u"none", nullptr, &size, &buffer), EFI_NOT_FOUND);

  // Through a device path on a LoadFile device.
  hostfw::NetworkDevice net(fw);
  net.PutFile(u"dir\\pkg", Pattern(123));
  std::vector<uint8_t> path = net.FilePath(u"dir\\pkg");
  ASSERT_EQ(
      nimb::BootFileReadWhole(net.Protocol(), nullptr, nullptr,
                              reinterpret_cast<EFI_DEVICE_PATH_PROTOCOL *>(path.data()), &size, &buffer),
      EFI_SUCCESS);
  EXPECT_EQ(size, 123u);
  // A path without a LoadFile device has nothing to read it with.
  EXPECT_EQ(
      nimb::BootFileReadWhole(nullptr, root_, nullptr,
                              reinterpret_cast<EFI_DEVICE_PATH_PROTOCOL *>(path.data()), &size, &buffer),
      EFI_INVALID_PARAMETER);
}

}  // namespace
