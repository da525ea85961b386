// Platform facts: the Data Hub's records in /efi/platform, the FACP through
// the ACPI root tables, and the model name.
#include "devicetree/platform.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <memory>
#include <string>
#include <tuple>
#include <utility>
#include <vector>

#include "devicetree/volume_uuid.h"
#include "efi/datahub.h"
#include "loader_fixture.h"
#include "support/devicepath.h"

namespace {

using Bytes = std::vector<uint8_t>;
using Properties = std::vector<std::pair<std::string, Bytes>>;
using nimbtest::Ucs2;

const EFI_GUID kOtherProducer =
    EFI_GUID_VALUE(0x11111111, 0x2222, 0x3333, 0x44, 0x55, 0x66, 0x77, 0x88, 0x99, 0xAA, 0xBB);
const EFI_GUID *const kVendor = &gNimbPlatformProducerGuid;

// `value` as `width` little-endian bytes.
Bytes Address(UINT64 value, size_t width) {
  Bytes b;
  for (size_t i = 0; i < width; i++)
    b.push_back(uint8_t(value >> (8 * i)));
  return b;
}

// The properties of /efi/platform in their order, "name" left out. With
// `unnamed`, a node that lost its name to an allocation failure counts too.
Properties PlatformProperties(bool unnamed = false) {
  nimb::DeviceTreeNode *node = nimb::DeviceTreeFindNode("/efi/platform", 0);
  if (node == nullptr && unnamed && nimb::gDeviceTreeRoot != nullptr &&
      nimb::gDeviceTreeRoot->children != nullptr)
    node = nimb::gDeviceTreeRoot->children->children;
  if (node == nullptr)
    return {{"(no node)", {}}};
  Properties found;
  for (nimb::DeviceTreeProperty *p = node->properties; p != nullptr; p = p->next) {
    const auto *value = static_cast<const uint8_t *>(p->value);
    if (std::string(p->name) != "name")
      found.push_back({p->name, value != nullptr ? Bytes(value, value + p->length) : Bytes(p->length, 0)});
  }
  return found;
}

struct Record {
  const EFI_GUID *producer;
  std::u16string name;
  Bytes value;
};

// A firmware of the row's own, with the loader pointed at it from a fresh
// start; what the loader took is given back when it goes.
struct Local {
  Local() { nimbtest::AttachTo(fw); }
  ~Local() {
    nimb::TrackedFreeAll();
    nimbtest::ResetLoaderState();
  }
  // The records, then one more that the walk never looks at (it comes with
  // the count 0).
  void Log(const std::vector<Record> &records) {
    for (const Record &r : records)
      fw.AddDataHubRecord(*r.producer, r.name, r.value);
    fw.AddDataHubRecord(*kVendor, u"last", {1});
  }
  // InitPlatformDescription, which must return success, then the model name.
  std::string Init() {
    std::string model;
    EXPECT_EQ(fw.Call([&] {
                  EXPECT_EQ(nimb::InitPlatformDescription(), EFI_SUCCESS);
                  model = nimb::GetModelName();
                }).end,
              hostfw::RunEnd::Returned);
    return model;
  }
  hostfw::Firmware fw;
};

TEST(PlatformTest, VendorRecordsBecomePropertiesInOrderUntilTheWalkStops) {
  const EFI_GUID *other = &kOtherProducer;
  struct Row {
    const char *name;
    std::vector<Record> records;
    const char *failing;  // service that fails on its `nth` call
    unsigned nth;
    Properties expected;
  };
  const std::vector<Row> rows = {
      {"no Data Hub", {}, nullptr, 0, {}},
      {"other producers skipped",
       {{other, u"A", {1}}, {kVendor, u"B", {2, 3}}, {other, u"B", {4}}, {kVendor, u"C", {5}}},
       nullptr,
       0,
       {{"B", {2, 3}}, {"C", {5}}}},
      {"names become UTF-8, values stay raw",
       {{kVendor, u"caf\u00e9\u4e2d", {0xFF, 0x00, 0x7F}}, {kVendor, u"n", {1}}, {kVendor, u"n", {2}}},
       nullptr,
       0,
       {{"caf\xC3\xA9\xE4\xB8\xAD", {0xFF, 0x00, 0x7F}}, {"n", {1}}, {"n", {2}}}},
      {"Data Hub not located", {{kVendor, u"a", {1}}}, "LocateProtocol", 1, {}},
      {"second record fails",
       {{kVendor, u"a", {1}}, {kVendor, u"b", {2}}},
       "GetNextDataRecord",
       2,
       {{"a", {1}}}},
  };
  for (const Row &row : rows) {
    Local local;
    if (!row.records.empty())
      local.Log(row.records);
    if (row.failing != nullptr)
      local.fw.FailCall(row.failing, row.nth, EFI_DEVICE_ERROR);
    local.Init();
    EXPECT_EQ(PlatformProperties(), row.expected) << row.name;
  }
}

// The model from the "Model" record, else from the DSDT's OEM fields, else
// "ACPI"; tables whose stated lengths are too short for a field are not read
// there.
TEST(PlatformTest, ModelNameFromRecordOrDsdtOrNeither) {
  std::string cut;  // 21 whole characters of three bytes fit in 64
  for (int i = 0; i < 21; i++)
    cut += "\xE4\xB8\xAD";
  // Tables whose FACP of `facpRevision` points at a DSDT of `id` and `revision`.
  auto acpi = [](std::string id, UINT32 revision, UINT8 facpRevision, bool dsdt32, bool dsdt64,
                 UINT32 facpLength, UINT32 dsdtLength, UINT32 rootLength, UINT8 rsdpRevision) {
    hostfw::AcpiOptions o;
    std::tie(o.oemTableId, o.oemRevision, o.facpRevision, o.dsdt32, o.dsdt64) =
        std::make_tuple(id, revision, facpRevision, dsdt32, dsdt64);
    std::tie(o.facpLength, o.dsdtLength, o.rsdpRevision) =
        std::make_tuple(facpLength, dsdtLength, rsdpRevision);
    o.otherTables = {};
    (rsdpRevision == 0 ? o.rsdtLength : o.xsdtLength) = rootLength;
    return o;
  };
  struct Row {
    Bytes model;  // the "Model" record's value; empty: no record
    std::vector<hostfw::AcpiOptions> tables;
    std::string expected;
  };
  const hostfw::AcpiOptions one = acpi("ABCD", 1, 4, true, true, 0, 0, 0, 2);
  const std::vector<Row> rows = {
      {Ucs2(u"Box4,2"), {one}, "Box4,2"},
      {Ucs2(std::u16string(u"Box4,2") + u'\0'), {}, "Box4,2"},
      {Ucs2(std::u16string(40, u'\u4e2d')), {}, cut},
      {Ucs2(std::u16string(2, u'\0')), {one}, "ACPI"},  // a record converting to nothing
      {{}, {acpi("ABCDEFGH", 0xFFFF0010, 4, true, true, 0, 0, 0, 2)}, "ABCDEFGH65535,16"},
      {{}, {acpi(std::string("XY\0\0\0\0\0\0", 8), 7, 4, true, true, 0, 0, 0, 2)}, "XY0,7"},
      {{}, {acpi("ABCD", 0x00010002, 4, false, true, 0, 0, 0, 2)}, "ABCD1,2"},  // blanks end the id
      {{}, {acpi("ABCD", 0x00010002, 4, true, false, 0, 0, 0, 2)}, "ACPI"},
      {{}, {acpi("ABCD", 0x00010002, 2, false, true, 244, 0, 0, 2)}, "ACPI"},
      {{}, {acpi("ABCD", 0x00010002, 2, true, false, 244, 0, 0, 2)}, "ABCD1,2"},
      {{}, {acpi("ABCD", 1, 2, true, true, 44, 0, 0, 0)}, "ABCD0,1"},
      {{}, {acpi("ABCD", 1, 1, true, true, 43, 0, 0, 0)}, "ACPI"},  // FACP too short for the DSDT
      {{}, {acpi("ABCD", 1, 3, true, true, 148, 0, 0, 2)}, "ABCD0,1"},
      {{}, {acpi("ABCD", 1, 3, true, true, 147, 0, 0, 2)}, "ACPI"},  // too short for the wide DSDT
      {{}, {acpi("ABCD", 1, 4, true, true, 0, 35, 0, 2)}, "ACPI"},   // DSDT shorter than a header
      {{}, {acpi("ABCD", 1, 4, true, true, 0, 0, 35, 0)}, "ACPI"},   // RSDT shorter than a header
      {{}, {acpi("ABCD", 1, 4, true, true, 0, 0, 43, 2)}, "ACPI"},   // XSDT with a part of an entry
      {{}, {}, "ACPI"},
  };
  for (const Row &row : rows) {
    Local local;
    if (!row.model.empty())
      local.Log({{kVendor, u"Model", row.model}});
    for (const hostfw::AcpiOptions &o : row.tables)
      local.fw.InstallAcpi(o);
    EXPECT_EQ(local.Init(), row.expected) << row.expected;
    // Worked out once: a later record changes nothing.
    static const char16_t kModel[] = u"Box";
    nimb::DeviceTreeAddProperty(nimb::DeviceTreeFindNode("/efi/platform", 0), "Model", sizeof(kModel), kModel,
                                1);
    EXPECT_EQ(nimb::GetModelName(), row.expected);
  }
}

// Records whose sizes lie are skipped; ASan sees any read past a record.
TEST(PlatformTest, LyingRecordSizesAreNeverFollowed) {
  auto data = [](uint32_t nameSize, uint32_t valueSize, size_t bytes) {
    Bytes d(16, 0xEE);
    for (uint32_t field : {nameSize, valueSize}) {
      const Bytes b = Address(field, 4);
      d.insert(d.end(), b.begin(), b.end());
    }
    for (size_t i = 0; i < bytes; i++)
      d.push_back(i % 2 == 0 ? uint8_t('a' + i / 2 % 26) : 0);
    return d;
  };
  // Only the first, third and fourth records' sizes hold.
  Local local;
  for (const Bytes &record : {data(4, 2, 6), data(4, 2, 5), data(0, 3, 3), data(7, 0, 7),
                              data(0xFFFFFFFF, 0, 8), data(8, 0xFFFFFFF8, 8), Bytes(23, 0), Bytes()})
    local.fw.AddDataHubRecordData(*kVendor, record);
  local.fw.AddDataHubRecord(*kVendor, u"last", {});
  local.Init();
  EXPECT_EQ(PlatformProperties(), (Properties{{"ab", {'c', 0}}, {"", {'a', 0, 'b'}}, {"abc", {}}}));
}

TEST(AcpiTest, FindFacpFollowsTheRsdpRevisionAndTheEntryOrder) {
  const EFI_GUID *v1 = &gEfiAcpi10TableGuid;
  const EFI_GUID *v2 = &gEfiAcpi20TableGuid;
  auto rsdp = [](UINT8 revision, bool rsdt = true, bool xsdt = true, bool facp = true) {
    hostfw::AcpiOptions o;
    o.rsdpRevision = revision;
    o.rsdt = rsdt;
    o.xsdt = xsdt;
    o.facp = facp;
    o.configurationGuids = {};
    return o;
  };
  struct Entry {
    const EFI_GUID *guid;
    int set;  // index into `sets`; -1 for a null table
  };
  struct Row {
    const char *name;
    std::vector<hostfw::AcpiOptions> sets;
    std::vector<Entry> entries;
    int expected;              // the set whose FACP is found, -1 for none
    bool asRevision1 = false;  // the first RSDP's revision made 1, its XSDT kept
  };
  const std::vector<Row> rows = {
      {"revision 1 names no root", {rsdp(2)}, {{v2, 0}}, -1, true},
      {"revision 2 through the 1.0 GUID reads the XSDT", {rsdp(2, false)}, {{v1, 0}}, 0},
      {"revision 2 without XSDT", {rsdp(2, true, false)}, {{v2, 0}}, -1},
      {"revision 0 through the 2.0 GUID reads the RSDT", {rsdp(0)}, {{v2, 0}}, 0},
      {"no FACP listed", {rsdp(2, true, true, false)}, {{v2, 0}}, -1},
      {"2.0 behind 1.0", {rsdp(0), rsdp(2)}, {{v1, 0}, {v2, 1}}, 1},
      {"later 1.0 replaces 1.0", {rsdp(0), rsdp(0)}, {{v1, 0}, {v1, 1}}, 1},
      {"first 2.0 wins", {rsdp(2), rsdp(2)}, {{v2, 0}, {v2, 1}}, 0},
      {"null 2.0 table passed over", {rsdp(0)}, {{v2, -1}, {v1, 0}}, 0},
  };
  for (const Row &row : rows) {
    Local local;
    std::vector<hostfw::AcpiTables> sets;
    for (const hostfw::AcpiOptions &options : row.sets)
      sets.push_back(local.fw.InstallAcpi(options));
    if (row.asRevision1)
      reinterpret_cast<UINT8 *>(sets[0].rsdp)[15] = 1;
    for (const Entry &entry : row.entries)
      local.fw.AddConfigurationTable(
          *entry.guid, entry.set < 0 ? nullptr : reinterpret_cast<void *>(sets[size_t(entry.set)].rsdp));
    EXPECT_EQ(reinterpret_cast<UINT64>(nimb::FindFacp()),
              row.expected < 0 ? 0 : sets[size_t(row.expected)].facp)
        << row.name;
  }
}

const EFI_GUID kPartitionGuid =
    EFI_GUID_VALUE(0x01234567, 0x89AB, 0xCDEF, 0x01, 0x23, 0x45, 0x67, 0x89, 0xAB, 0xCD, 0xEF);
const char kPartitionText[] = "01234567-89AB-CDEF-0123-456789ABCDEF";
const Bytes kId = {1, 2, 3, 4, 5, 6, 7, 8};
const char kIdText[] = "6095E009-5132-3FC5-87C2-D5A01745283E";
const Bytes kZeroId(8, 0);
const char kZeroIdText[] = "A97C9EAF-E18F-3BE3-80CD-8A8C6FB6E8E7";

// 37 bytes written; a destination that cannot hold them is not written.
TEST(VolumeUuidTest, NameBasedUuidOfAnIdentifier) {
  for (UINTN size : {64, 36}) {
    char text[64];
    std::memset(text, 'z', sizeof(text));
    EXPECT_EQ(nimb::UuidFromVolumeId(kId.data(), kId.size(), size, text),
              size == 64 ? EFI_SUCCESS : EFI_BUFFER_TOO_SMALL);
    EXPECT_EQ(std::string(text, 38), size == 64 ? kIdText + std::string("\0z", 2) : std::string(38, 'z'));
  }
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
