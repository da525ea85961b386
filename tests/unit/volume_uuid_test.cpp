// The boot volume's UUID: from the partition's GUID, or name-based from the
// identifier in the volume header (behind a wrapper or not).
#include "devicetree/volume_uuid.h"

#include <gtest/gtest.h>

#include <cstring>
#include <memory>
#include <string>
#include <vector>

#include "loader_fixture.h"
#include "support/devicepath.h"

namespace {

using Bytes = std::vector<uint8_t>;

const EFI_GUID kPartitionGuid =
    EFI_GUID_VALUE(0x01234567, 0x89AB, 0xCDEF, 0x01, 0x23, 0x45, 0x67, 0x89, 0xAB, 0xCD, 0xEF);
const char kPartitionText[] = "01234567-89AB-CDEF-0123-456789ABCDEF";
const Bytes kId = {1, 2, 3, 4, 5, 6, 7, 8};
const char kIdText[] = "6095E009-5132-3FC5-87C2-D5A01745283E";
const Bytes kZeroId(8, 0);
const char kZeroIdText[] = "A97C9EAF-E18F-3BE3-80CD-8A8C6FB6E8E7";

std::string UuidOf(const Bytes &id) {
  char text[64];
  std::memset(text, 'z', sizeof(text));
  EXPECT_EQ(nimb::UuidFromVolumeId(id.data(), id.size(), sizeof(text), text), EFI_SUCCESS);
  EXPECT_EQ(text[36], '\0');
  EXPECT_EQ(text[37], 'z') << "37 bytes written";
  return text;
}

TEST(VolumeUuidTest, NameBasedUuidOfAnIdentifier) {
  EXPECT_EQ(UuidOf(kId), kIdText);
  // A destination that cannot hold the text is not written.
  char small[36];
  std::memset(small, 'z', sizeof(small));
  EXPECT_EQ(nimb::UuidFromVolumeId(kId.data(), kId.size(), sizeof(small), small), EFI_BUFFER_TOO_SMALL);
  EXPECT_EQ(std::string(small, sizeof(small)), std::string(sizeof(small), 'z'));
}

// The volume header, with its big-endian fields.
struct Header {
  uint16_t signature;
  Bytes id = kId;
  uint32_t blockSize = 0;
  uint16_t firstSector = 0;
  uint16_t embeddedSignature = 0;
  uint16_t embeddedBlock = 0;
};

void PutBe(Bytes &disk, size_t at, uint64_t value, size_t width) {
  for (size_t i = 0; i < width; i++)
    disk[at + i] = uint8_t(value >> (8 * (width - 1 - i)));
}

void Write(Bytes &disk, size_t at, const Header &h) {
  PutBe(disk, at, h.signature, 2);
  PutBe(disk, at + 20, h.blockSize, 4);
  PutBe(disk, at + 28, h.firstSector, 2);
  std::copy(h.id.begin(), h.id.end(), disk.begin() + long(at) + 104);
  PutBe(disk, at + 124, h.embeddedSignature, 2);
  PutBe(disk, at + 126, h.embeddedBlock, 2);
}

class VolumeUuidDiskTest : public nimbtest::LoaderTest {
 protected:
  // A whole disk of `size` bytes with the headers at their offsets, and the
  // hard-drive nodes in its path.
  EFI_HANDLE Disk(const std::vector<std::pair<size_t, Header>> &headers,
                  const std::vector<hostfw::HardDriveNode> &nodes = {}, size_t size = 32768) {
    auto image = std::make_shared<Bytes>(size, 0);
    for (const auto &[at, header] : headers)
      Write(*image, at, header);
    EFI_HANDLE handle = fw.AddBlockDevice(image);
    if (!nodes.empty())
      fw.SetHardDrivePath(handle, nodes);
    return handle;
  }
  EFI_STATUS Uuid(EFI_HANDLE handle, std::string *text) {
    char buffer[64] = {};
    EFI_STATUS status = EFI_ABORTED;
    EXPECT_EQ(fw.Call([&] { status = nimb::GetVolumeUuid(handle, sizeof(buffer), buffer); }).end,
              hostfw::RunEnd::Returned);
    *text = buffer;
    return status;
  }
};

TEST_F(VolumeUuidDiskTest, PartitionGuidOrVolumeHeader) {
  using hostfw::HardDriveNode;
  HardDriveNode gptMbrSignature = HardDriveNode::Gpt(kPartitionGuid);
  gptMbrSignature.signatureType = 1;
  HardDriveNode mbrGuidSignature = HardDriveNode::Gpt(kPartitionGuid);
  mbrGuidSignature.format = 1;
  const Header plain = {0x482B};
  const Header wrapper = {0x4244, kId, 0x200, 3, 0x482B, 16};
  Header otherEmbedded = wrapper;
  otherEmbedded.embeddedSignature = 0x4858;
  const Header atZero = {0x4244, kId, 0, 0, 0x482B, 0};
  const Header pastTheDisk = {0x4244, kId, 0x10000, 0xFFFF, 0x482B, 0xFFFF};
  struct Row {
    const char *name;
    std::vector<std::pair<size_t, Header>> headers;
    std::vector<HardDriveNode> nodes;
    std::string text;  // empty: refused with `status`
    unsigned reads;
    EFI_STATUS status = EFI_SUCCESS;
    size_t size = 32768;
  };
  const std::vector<Row> rows = {
      {"GUID partition", {{1024, plain}}, {HardDriveNode::Gpt(kPartitionGuid)}, kPartitionText, 0},
      {"MBR partition", {{1024, plain}}, {HardDriveNode::Mbr(0xDEADBEEF)}, kIdText, 1},
      {"GUID table, MBR signature", {{1024, plain}}, {gptMbrSignature}, kIdText, 1},
      {"MBR table, GUID signature", {{1024, plain}}, {mbrGuidSignature}, kIdText, 1},
      {"whole disk", {{1024, plain}}, {}, kIdText, 1},
      {"other volume signature", {{1024, {0x4858}}}, {}, kIdText, 1},
      {"unknown signature", {{1024, {0x482A}}}, {}, "", 1, EFI_UNSUPPORTED},
      {"wrapper", {{1024, wrapper}, {10752, {0x482B, kZeroId}}}, {}, kZeroIdText, 2},
      {"embedded volume unknown", {{1024, wrapper}, {10752, {0x1234, kZeroId}}}, {}, "", 2, EFI_UNSUPPORTED},
      {"other embedded kind", {{1024, otherEmbedded}, {10752, plain}}, {}, "", 1, EFI_UNSUPPORTED},
      {"wrapper at offset 0", {{1024, atZero}}, {}, "", 1, EFI_UNSUPPORTED},
      {"wrapper past the disk", {{1024, pastTheDisk}}, {}, "", 2, EFI_INVALID_PARAMETER},
  };
  for (const Row &row : rows) {
    const unsigned readsBefore = fw.CallCount("ReadDisk");
    EFI_HANDLE disk = Disk(row.headers, row.nodes, row.size);
    std::string text;
    EXPECT_EQ(Uuid(disk, &text), row.status) << row.name;
    EXPECT_EQ(text, row.text) << row.name;
    EXPECT_EQ(fw.CallCount("ReadDisk") - readsBefore, row.reads) << row.name;
  }
}

// A hard-drive node cut short of its format fields, followed by a node
// whose first two bytes would read as "GUID table, GUID signature".
TEST_F(VolumeUuidDiskTest, AShortHardDriveNodeIsSteppedOver) {
  hostfw::HardDriveNode cut = hostfw::HardDriveNode::Gpt(kPartitionGuid);
  cut.length = 40;
  EFI_HANDLE disk = Disk({{1024, {0x482B}}}, {cut});
  const auto *path = reinterpret_cast<const uint8_t *>(fw.DevicePathOf(disk));
  Bytes bytes(path, path + nimb::DevicePathSize(fw.DevicePathOf(disk)) - 4);
  bytes.insert(bytes.end(),
               {ACPI_DEVICE_PATH, 2, 4, 0, END_DEVICE_PATH_TYPE, END_ENTIRE_DEVICE_PATH_SUBTYPE, 4, 0});
  fw.SetDevicePath(disk, bytes);
  std::string text;
  EXPECT_EQ(Uuid(disk, &text), EFI_SUCCESS);
  EXPECT_EQ(text, kIdText);
}

TEST_F(VolumeUuidDiskTest, FailuresReturnTheFirmwaresStatus) {
  const EFI_GUID *blockIo = &gEfiBlockIoProtocolGuid;
  struct Row {
    const char *name;
    const char *service;  // that fails; null for an allocation
    unsigned nth;
    const EFI_GUID *protocol;
    EFI_STATUS status;
  };
  const Row rows[] = {
      {"no BlockIO", "HandleProtocol", 1, blockIo, EFI_NO_MEDIA},
      {"header unreadable", "ReadDisk", 1, nullptr, EFI_DEVICE_ERROR},
      {"embedded header unreadable", "ReadDisk", 2, nullptr, EFI_MEDIA_CHANGED},
      {"no memory", nullptr, 1, nullptr, EFI_OUT_OF_RESOURCES},
  };
  for (const Row &row : rows) {
    EFI_HANDLE disk = Disk({{1024, {0x4244, kId, 0x200, 3, 0x482B, 16}}, {10752, {0x482B}}});
    if (row.service != nullptr)
      fw.FailCall(row.service, row.nth, row.status, row.protocol);
    else
      fw.FailAllocation(row.nth, EFI_BUFFER_TOO_SMALL);
    std::string text;
    EXPECT_EQ(Uuid(disk, &text), row.status) << row.name;
    EXPECT_EQ(text, "") << row.name;
  }
  // A network boot's handle: no device path to search, and no BlockIO.
  std::string text;
  EXPECT_EQ(Uuid(fw.NewHandle(), &text), EFI_UNSUPPORTED);
}

}  // namespace
