// Platform facts: the Data Hub's records in /efi/platform, the FACP through
// the ACPI root tables, and the model name.
#include "devicetree/platform.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <string>
#include <utility>
#include <vector>

#include "efi/datahub.h"
#include "loader_fixture.h"

namespace {

using Bytes = std::vector<uint8_t>;
using Properties = std::vector<std::pair<std::string, Bytes>>;

const EFI_GUID kOtherProducer =
    EFI_GUID_VALUE(0x11111111, 0x2222, 0x3333, 0x44, 0x55, 0x66, 0x77, 0x88, 0x99, 0xAA, 0xBB);
const EFI_GUID *const kVendor = &gNimbPlatformProducerGuid;

Bytes Ucs2(const std::u16string &text) {
  Bytes bytes;
  for (char16_t unit : text)
    bytes.insert(bytes.end(), {uint8_t(unit), uint8_t(unit >> 8)});
  return bytes;
}

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
  struct Acpi {
    std::string id;
    UINT32 revision;
    UINT8 facpRevision;
    bool dsdt32, dsdt64;
    UINT32 facpLength, dsdtLength, rootLength;
    UINT8 rsdpRevision;
  };
  struct Row {
    Bytes model;  // the "Model" record's value; empty: no record
    std::vector<Acpi> tables;
    std::string expected;
  };
  const Acpi one = {"ABCD", 1, 4, true, true, 0, 0, 0, 2};
  const std::vector<Row> rows = {
      {Ucs2(u"Box4,2"), {one}, "Box4,2"},
      {Ucs2(std::u16string(u"Box4,2") + u'\0'), {}, "Box4,2"},
      {Ucs2(std::u16string(40, u'\u4e2d')), {}, cut},
      {Ucs2(std::u16string(2, u'\0')), {one}, "ACPI"},  // a record converting to nothing
      {{}, {{"ABCDEFGH", 0xFFFF0010, 4, true, true, 0, 0, 0, 2}}, "ABCDEFGH65535,16"},
      {{}, {{std::string("XY\0\0\0\0\0\0", 8), 7, 4, true, true, 0, 0, 0, 2}}, "XY0,7"},
      {{}, {{"ABCD", 0x00010002, 4, false, true, 0, 0, 0, 2}}, "ABCD1,2"},  // blanks end the id
      {{}, {{"ABCD", 0x00010002, 4, true, false, 0, 0, 0, 2}}, "ACPI"},
      {{}, {{"ABCD", 0x00010002, 2, false, true, 244, 0, 0, 2}}, "ACPI"},
      {{}, {{"ABCD", 0x00010002, 2, true, false, 244, 0, 0, 2}}, "ABCD1,2"},
      {{}, {{"ABCD", 1, 2, true, true, 44, 0, 0, 0}}, "ABCD0,1"},
      {{}, {{"ABCD", 1, 1, true, true, 43, 0, 0, 0}}, "ACPI"},  // FACP too short for the DSDT
      {{}, {{"ABCD", 1, 3, true, true, 148, 0, 0, 2}}, "ABCD0,1"},
      {{}, {{"ABCD", 1, 3, true, true, 147, 0, 0, 2}}, "ACPI"},  // too short for the wide DSDT
      {{}, {{"ABCD", 1, 4, true, true, 0, 35, 0, 2}}, "ACPI"},   // DSDT shorter than a header
      {{}, {{"ABCD", 1, 4, true, true, 0, 0, 35, 0}}, "ACPI"},   // RSDT shorter than a header
      {{}, {{"ABCD", 1, 4, true, true, 0, 0, 43, 2}}, "ACPI"},   // XSDT with a part of an entry
      {{}, {}, "ACPI"},
  };
  for (const Row &row : rows) {
    Local local;
    if (!row.model.empty())
      local.Log({{kVendor, u"Model", row.model}});
    for (const Acpi &a : row.tables) {
      hostfw::AcpiOptions o;
      o.oemTableId = a.id;
      o.oemRevision = a.revision;
      o.facpRevision = a.facpRevision;
      o.dsdt32 = a.dsdt32;
      o.dsdt64 = a.dsdt64;
      o.facpLength = a.facpLength;
      o.dsdtLength = a.dsdtLength;
      o.rsdpRevision = a.rsdpRevision;
      o.otherTables = {};
      (a.rsdpRevision == 0 ? o.rsdtLength : o.xsdtLength) = a.rootLength;
      local.fw.InstallAcpi(o);
    }
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
  struct Row {
    Bytes data;
    bool kept;
  };
  const std::vector<Row> rows = {
      {data(4, 2, 6), true},           {data(4, 2, 5), false},
      {data(0, 3, 3), true},           {data(7, 0, 7), true},
      {data(0xFFFFFFFF, 0, 8), false}, {data(8, 0xFFFFFFF8, 8), false},
      {Bytes(23, 0), false},           {Bytes(), false},
  };
  Local local;
  for (const Row &row : rows)
    local.fw.AddDataHubRecordData(*kVendor, row.data);
  local.fw.AddDataHubRecord(*kVendor, u"last", {});
  local.Init();
  Properties found = PlatformProperties();
  size_t at = 0;
  for (const Row &row : rows) {
    if (!row.kept)
      continue;
    uint32_t nameSize, valueSize;
    std::memcpy(&nameSize, &row.data[16], 4);
    std::memcpy(&valueSize, &row.data[20], 4);
    ASSERT_LT(at, found.size());
    EXPECT_EQ(found[at].second,
              Bytes(row.data.begin() + 24 + nameSize, row.data.begin() + 24 + nameSize + valueSize));
    EXPECT_EQ(found[at++].first.size(), nameSize / 2);
  }
  EXPECT_EQ(found.size(), at);
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

}  // namespace
