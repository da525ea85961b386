// Platform facts: the Data Hub's records in /efi/platform, the FACP through
// the ACPI root tables, the model name; and the host firmware's Data Hub and
// ACPI tables behind them.
#include "devicetree/platform.h"

#include <gtest/gtest.h>
#include <sys/mman.h>

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

Bytes Ucs2(const std::u16string &text) {
  Bytes bytes;
  for (char16_t unit : text) {
    bytes.push_back(uint8_t(unit));
    bytes.push_back(uint8_t(unit >> 8));
  }
  return bytes;
}

// `value` as `width` little-endian bytes.
Bytes Address(UINT64 value, size_t width) {
  Bytes b;
  for (size_t i = 0; i < width; i++)
    b.push_back(uint8_t(value >> (8 * i)));
  return b;
}

void Put32(Bytes &bytes, uint32_t value) {
  const Bytes b = Address(value, 4);
  bytes.insert(bytes.end(), b.begin(), b.end());
}

// The properties of /efi/platform in their order, "name" left out. With
// `unnamed` set, a node that lost its name to an allocation failure counts
// too: the platform node is then the only grandchild of the root.
Properties PlatformProperties(bool unnamed = false) {
  Properties found;
  nimb::DeviceTreeNode *node = nimb::DeviceTreeFindNode("/efi/platform", 0);
  if (node == nullptr && unnamed && nimb::gDeviceTreeRoot != nullptr &&
      nimb::gDeviceTreeRoot->children != nullptr)
    node = nimb::gDeviceTreeRoot->children->children;
  if (node == nullptr)
    return {{"(no node)", {}}};
  for (nimb::DeviceTreeProperty *p = node->properties; p != nullptr; p = p->next) {
    if (std::string(p->name) == "name")
      continue;
    const auto *value = static_cast<const uint8_t *>(p->value);
    found.push_back({p->name, value != nullptr ? Bytes(value, value + p->length) : Bytes(p->length, 0)});
  }
  return found;
}

struct Record {
  const EFI_GUID *producer;
  std::u16string name;
  Bytes value;
};
const EFI_GUID *const kVendor = &gNimbPlatformProducerGuid;

// A firmware of the row's own, with the loader pointed at it from a fresh
// start; what the loader took is given back when it goes.
struct Local {
  Local() {
    nimbtest::ResetLoaderState();
    nimb::gST = fw.SystemTable();
    nimb::gBS = fw.BootServices();
    nimb::gRT = fw.RuntimeServices();
    nimb::gImageHandle = fw.ImageHandle();
  }
  ~Local() {
    nimb::TrackedFreeAll();
    nimbtest::ResetLoaderState();
  }
  // Logs the records, then one more that the walk never looks at (it comes
  // with the count 0).
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

TEST(PlatformTest, VendorRecordsBecomePlatformPropertiesInOrder) {
  const EFI_GUID *other = &kOtherProducer;
  struct Row {
    const char *name;
    std::vector<Record> records;
    Properties expected;
  };
  const std::vector<Row> rows = {
      {"no record but the last", {}, {}},
      {"other producers skipped",
       {{other, u"A", {1}}, {kVendor, u"B", {2, 3}}, {other, u"B", {4}}, {kVendor, u"C", {5}}},
       {{"B", {2, 3}}, {"C", {5}}}},
      {"names become UTF-8, values stay raw",
       {{kVendor, u"caf\u00e9\u4e2d", {0xFF, 0x00, 0x7F}}, {kVendor, u"t", Ucs2(u"x\0")}},
       {{"caf\xC3\xA9\xE4\xB8\xAD", {0xFF, 0x00, 0x7F}}, {"t", Ucs2(u"x\0")}}},
      {"same name twice", {{kVendor, u"n", {1}}, {kVendor, u"n", {2}}}, {{"n", {1}}, {"n", {2}}}},
  };
  for (const Row &row : rows) {
    Local local;
    local.Log(row.records);
    local.Init();
    EXPECT_EQ(PlatformProperties(), row.expected) << row.name;
    EXPECT_EQ(local.fw.CallCount("GetNextDataRecord"), row.records.size() + 1) << row.name;
  }
}

TEST(PlatformTest, AWalkThatCannotStartOrGoOnKeepsWhatItHas) {
  struct Row {
    const char *name;
    bool hub;
    const char *failing;  // service that fails, on its `nth` call
    unsigned nth;
    const EFI_GUID *protocol;  // the call's protocol, for the services that take one
    Properties expected;
  };
  const std::vector<Row> rows = {
      {"no Data Hub", false, nullptr, 0, nullptr, {}},
      {"Data Hub not located", true, "LocateProtocol", 1, &gEfiDataHubProtocolGuid, {}},
      {"second record fails", true, "GetNextDataRecord", 2, nullptr, {{"a", {1}}}},
      {"whole walk", true, nullptr, 0, nullptr, {{"a", {1}}, {"b", {2}}}},
  };
  for (const Row &row : rows) {
    Local local;
    if (row.hub)
      local.Log({{kVendor, u"a", {1}}, {kVendor, u"b", {2}}});
    if (row.failing != nullptr)
      local.fw.FailCall(row.failing, row.nth, EFI_DEVICE_ERROR, row.protocol);
    local.Init();
    EXPECT_EQ(PlatformProperties(), row.expected) << row.name;
  }
}

// Whichever allocation fails, the walk goes on and loses at most the record
// it was at; only a tree that cannot start at all is fatal, and that comes
// before any record is read.
TEST(PlatformTest, AnAllocationFailureLosesAtMostOneRecord) {
  const Properties all = {{"a", {1}}, {"b", {2}}, {"c", {3}}};
  bool started = false;
  unsigned lost = 0;
  for (unsigned nth = 1; nth <= 16; nth++) {
    Local local;
    local.Log({{kVendor, u"a", {1}}, {kVendor, u"b", {2}}, {kVendor, u"c", {3}}});
    local.fw.FailAllocation(nth);
    hostfw::RunResult result = local.fw.Call([] { nimb::InitPlatformDescription(); });
    if (result.end == hostfw::RunEnd::Exited) {
      EXPECT_FALSE(started) << nth;
      EXPECT_EQ(result.status, EFI_ABORTED) << nth;
      // The tree's first block, or the memory tracking's own.
      const std::string text = local.fw.ConOutText();
      EXPECT_TRUE(text == "Couldn't create root node" || text == "Can't allocate memory tag") << nth << text;
      EXPECT_EQ(local.fw.CallCount("GetNextDataRecord"), 0u) << nth;
      continue;
    }
    ASSERT_EQ(result.end, hostfw::RunEnd::Returned) << nth;
    started = true;
    Properties found = PlatformProperties(true);
    size_t matched = 0;
    for (const auto &property : all)
      matched += matched < found.size() && found[matched] == property;
    EXPECT_EQ(matched, found.size()) << nth << ": not a part of the records, in order";
    EXPECT_GE(found.size(), all.size() - 1) << nth;
    lost += found.size() < all.size();
  }
  EXPECT_TRUE(started);
  EXPECT_GE(lost, 3u) << "each record's allocations were reached";
}

// --- the model name -------------------------------------------------------------

TEST(PlatformTest, ModelNameFromRecordOrDsdtOrNeither) {
  std::string cut;  // 21 whole characters of three bytes fit in 64
  for (int i = 0; i < 21; i++)
    cut += "\xE4\xB8\xAD";
  auto acpi = [](std::string id, UINT32 revision, UINT8 facpRevision, bool dsdt32, bool dsdt64) {
    hostfw::AcpiOptions o;
    o.oemTableId = std::move(id);
    o.oemRevision = revision;
    o.facpRevision = facpRevision;
    o.facpLength = facpRevision < 3 ? 244 : 0;
    o.dsdt32 = dsdt32;
    o.dsdt64 = dsdt64;
    return o;
  };
  const hostfw::AcpiOptions one = acpi("ABCD", 1, 4, true, true),
                            both = acpi("ABCD", 0x00010002, 4, true, true),
                            eight = acpi("ABCDEFGH", 0xFFFF0010, 4, true, true),
                            nuls = acpi(std::string("XY\0\0\0\0\0\0", 8), 7, 4, true, true),
                            new64 = acpi("ABCD", 0x00010002, 4, false, true),
                            new32 = acpi("ABCD", 0x00010002, 4, true, false),
                            old64 = acpi("ABCD", 0x00010002, 2, false, true),
                            old32 = acpi("ABCD", 0x00010002, 2, true, false);
  struct Row {
    const char *name;
    Bytes model;  // the "Model" record's value; empty: no record
    const hostfw::AcpiOptions *acpi;
    std::string expected;
  };
  const std::vector<Row> rows = {
      {"record without NUL", Ucs2(u"Box4,2"), &one, "Box4,2"},
      {"record with NUL", Ucs2(std::u16string(u"Box4,2") + u'\0'), nullptr, "Box4,2"},
      {"40 wide characters cut whole", Ucs2(std::u16string(40, u'\u4e2d')), nullptr, cut},
      {"record converting to nothing", Ucs2(std::u16string(2, u'\0')), &one, "ACPI"},
      {"DSDT id with blanks", {}, &both, "ABCD1,2"},
      {"DSDT id of 8 characters", {}, &eight, "ABCDEFGH65535,16"},
      {"DSDT id with NULs", {}, &nuls, "XY0,7"},
      {"new FACP reads the 64-bit field", {}, &new64, "ABCD1,2"},
      {"new FACP ignores the 32-bit field", {}, &new32, "ACPI"},
      {"old FACP ignores the 64-bit field", {}, &old64, "ACPI"},
      {"old FACP reads the 32-bit field", {}, &old32, "ABCD1,2"},
      {"neither", {}, nullptr, "ACPI"},
  };
  for (const Row &row : rows) {
    Local local;
    if (!row.model.empty())
      local.Log({{kVendor, u"Model", row.model}});
    if (row.acpi != nullptr)
      local.fw.InstallAcpi(*row.acpi);
    EXPECT_EQ(local.Init(), row.expected) << row.name;
    EXPECT_EQ(nimb::GetModelName(), nimb::gModelName) << row.name;
  }

  // Worked out once: neither a later record nor later tables change it.
  Local local;
  EXPECT_EQ(local.Init(), "ACPI");
  static const char16_t kModel[] = u"Box";
  nimb::DeviceTreeAddProperty(nimb::DeviceTreeFindNode("/efi/platform", 0), "Model", sizeof(kModel), kModel,
                              1);
  local.fw.InstallAcpi({});
  EXPECT_STREQ(nimb::GetModelName(), "ACPI");
}

// --- the host firmware's Data Hub ---------------------------------------------

TEST(DataHubTest, CountsRunThroughTheRecordsAndEndAtZeroWithTheLast) {
  hostfw::Firmware local;
  EFI_DATA_HUB_PROTOCOL *hub = nullptr;
  auto locate = [&] {
    return local.BootServices()->LocateProtocol(&gEfiDataHubProtocolGuid, nullptr,
                                                reinterpret_cast<void **>(&hub));
  };
  EXPECT_EQ(locate(), EFI_NOT_FOUND) << "no record, no hub";
  local.AddDataHubRecord(gNimbPlatformProducerGuid, u"a", {1, 2});
  local.AddDataHubRecord(kOtherProducer, u"bc", {});
  ASSERT_EQ(locate(), EFI_SUCCESS);
  // Header, name and value sizes, the name, the value.
  const UINT32 sizes[] = {96 + 4 + 2, 96 + 6};
  UINT64 count = 0;
  for (size_t i = 0; i < 2; i++) {
    EFI_DATA_RECORD_HEADER *record = nullptr;
    ASSERT_EQ(hub->GetNextDataRecord(hub, &count, nullptr, &record), EFI_SUCCESS) << i;
    EXPECT_EQ(record->RecordSize, sizes[i]) << i;
    EXPECT_EQ(count, i == 0 ? record->LogMonotonicCount + 1 : 0) << i;
  }
  count = 7;
  EFI_DATA_RECORD_HEADER *record = nullptr;
  EXPECT_EQ(hub->GetNextDataRecord(hub, &count, nullptr, &record), EFI_NOT_FOUND);
}

// Records whose sizes lie are skipped; ASan sees any read past a record.
TEST(PlatformTest, LyingRecordSizesAreNeverFollowed) {
  auto data = [](uint32_t nameSize, uint32_t valueSize, size_t bytes) {
    Bytes d(16, 0xEE);
    Put32(d, nameSize);
    Put32(d, valueSize);
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
      {data(4, 0, 4), true},           {data(0, 3, 3), true},
      {data(7, 0, 7), true},           {data(0xFFFFFFFF, 0, 8), false},
      {data(8, 0xFFFFFFF8, 8), false}, {data(0x80000000, 0x80000000, 2), false},
      {Bytes(23, 0), false},           {Bytes(), false},
  };
  // And a stream of records of every shape.
  std::vector<Row> all = rows;
  uint32_t seed = 12345;
  auto next = [&seed] { return seed = seed * 1103515245u + 12345u; };
  for (int i = 0; i < 200; i++) {
    const uint32_t nameSize = next() % 24, valueSize = next() % 24, bytes = next() % 40;
    all.push_back({data(nameSize, valueSize, bytes), nameSize + valueSize <= bytes});
  }
  Local local;
  for (const Row &row : all)
    local.fw.AddDataHubRecordData(*kVendor, row.data);
  local.fw.AddDataHubRecord(*kVendor, u"last", {});
  local.Init();

  size_t kept = 0;
  for (const Row &row : all)
    kept += row.kept;
  Properties found = PlatformProperties();
  ASSERT_EQ(found.size(), kept);
  size_t at = 0;
  for (size_t i = 0; i < rows.size(); i++) {
    if (!rows[i].kept)
      continue;
    uint32_t nameSize, valueSize;
    std::memcpy(&nameSize, &rows[i].data[16], 4);
    std::memcpy(&valueSize, &rows[i].data[20], 4);
    EXPECT_EQ(found[at].second,
              Bytes(rows[i].data.begin() + 24 + nameSize, rows[i].data.begin() + 24 + nameSize + valueSize))
        << i;
    EXPECT_EQ(found[at].first.size(), nameSize / 2) << i;
    at++;
  }
}

// --- the FACP, through the host firmware's ACPI tables -----------------------------

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
    int expected;  // the set whose FACP is found, -1 for none
  };
  const std::vector<Row> rows = {
      {"revision 0", {rsdp(0)}, {{v1, 0}}, 0},
      {"revision 1", {rsdp(1)}, {{v1, 0}}, -1},
      {"revision 2", {rsdp(2)}, {{v2, 0}}, 0},
      {"revision 2 through the 1.0 GUID reads the XSDT", {rsdp(2, false)}, {{v1, 0}}, 0},
      {"revision 2 without XSDT", {rsdp(2, true, false)}, {{v2, 0}}, -1},
      {"revision 0 through the 2.0 GUID reads the RSDT", {rsdp(0)}, {{v2, 0}}, 0},
      {"no FACP listed", {rsdp(2, true, true, false)}, {{v2, 0}}, -1},
      {"2.0 behind 1.0", {rsdp(0), rsdp(2)}, {{v1, 0}, {v2, 1}}, 1},
      {"later 1.0 replaces 1.0", {rsdp(0), rsdp(0)}, {{v1, 0}, {v1, 1}}, 1},
      {"first 2.0 wins", {rsdp(2), rsdp(2)}, {{v2, 0}, {v2, 1}}, 0},
      {"null 2.0 table passed over", {rsdp(0)}, {{v2, -1}, {v1, 0}}, 0},
      {"no ACPI", {}, {{&gEfiDevicePathProtocolGuid, -1}}, -1},
  };
  for (const Row &row : rows) {
    Local local;
    std::vector<hostfw::AcpiTables> sets;
    for (const hostfw::AcpiOptions &options : row.sets)
      sets.push_back(local.fw.InstallAcpi(options));
    for (const Entry &entry : row.entries) {
      void *table = entry.set < 0 ? nullptr : reinterpret_cast<void *>(sets[size_t(entry.set)].rsdp);
      local.fw.AddConfigurationTable(*entry.guid, table);
    }
    const UINT8 *facp = nimb::FindFacp();
    EXPECT_EQ(reinterpret_cast<UINT64>(facp), row.expected < 0 ? 0 : sets[size_t(row.expected)].facp)
        << row.name;
  }
}

TEST(AcpiTest, TablesLieInAcpiMemoryWithTheirChecksumsRight) {
  for (UINT8 revision : {UINT8(0), UINT8(2)}) {
    hostfw::Firmware local;
    hostfw::AcpiOptions options;
    options.rsdpRevision = revision;
    hostfw::AcpiTables t = local.InstallAcpi(options);
    auto sum = [&](UINT64 address, size_t length) {
      uint8_t s = 0;
      for (size_t i = 0; i < length; i++)
        s = uint8_t(s + reinterpret_cast<const uint8_t *>(address)[i]);
      return s;
    };
    auto typeOf = [&](UINT64 address) {
      for (const EFI_MEMORY_DESCRIPTOR &d : local.MemoryMap()) {
        if (address - d.PhysicalStart < d.NumberOfPages * EFI_PAGE_SIZE)
          return d.Type;
      }
      return UINT32(EfiMaxMemoryType);
    };
    EXPECT_EQ(sum(t.rsdp, 20), 0) << int(revision);
    if (revision == 2)
      EXPECT_EQ(sum(t.rsdp, 36), 0);
    for (UINT64 table : {t.rsdt, t.facp, t.dsdt, revision == 2 ? t.xsdt : t.rsdt}) {
      UINT32 length;
      std::memcpy(&length, reinterpret_cast<const void *>(table + 4), 4);
      EXPECT_EQ(sum(table, length), 0)
          << int(revision) << " " << std::string(reinterpret_cast<const char *>(table), 4);
      EXPECT_EQ(typeOf(table), UINT32(EfiACPIReclaimMemory));
    }
    EXPECT_EQ(typeOf(t.facs), UINT32(EfiACPIMemoryNVS));
  }
}

// Bytes placed flush against a page that cannot be read, below 2 GiB so that
// 32-bit table addresses reach them: reading one byte too far faults.
class GuardedBytes {
 public:
  explicit GuardedBytes(const Bytes &bytes) {
    void *pages =
        mmap(nullptr, 2 * kPage, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS | MAP_32BIT, -1, 0);
    if (pages == MAP_FAILED)
      ADD_FAILURE() << "no low pages";
    base_ = static_cast<uint8_t *>(pages);
    mprotect(base_ + kPage, kPage, PROT_NONE);
    std::memcpy(base_ + kPage - bytes.size(), bytes.data(), bytes.size());
    address_ = reinterpret_cast<UINT64>(base_ + kPage - bytes.size());
  }
  ~GuardedBytes() { munmap(base_, 2 * kPage); }
  GuardedBytes(const GuardedBytes &) = delete;
  GuardedBytes &operator=(const GuardedBytes &) = delete;
  UINT64 address() const { return address_; }

 private:
  static constexpr size_t kPage = 4096;
  uint8_t *base_ = nullptr;
  UINT64 address_ = 0;
};

// A table of `size` bytes, stating `length`, with `fill` behind the header.
Bytes Table(const char *signature, uint32_t length, size_t size, const Bytes &body = {}) {
  Bytes t(signature, signature + 4);
  Put32(t, length);
  t.resize(36, 0);
  t.insert(t.end(), body.begin(), body.end());
  t.resize(size, 0);
  return t;
}

TEST(AcpiTest, LyingLengthsAreNeverReadPast) {
  struct Row {
    const char *name;
    UINT8 revision;       // of the RSDP
    uint32_t rootLength;  // stated by the root table, which is this long
    uint32_t facpLength;  // stated by the FACP, which is this long
    UINT8 facpRevision;
    uint32_t dsdtLength;  // stated by the DSDT, which is this long
    bool facpFound;
    const char *model;
  };
  const std::vector<Row> rows = {
      {"RSDT shorter than a header", 0, 35, 116, 1, 36, false, "ACPI"},
      {"XSDT with a part of an entry", 2, 43, 244, 4, 36, false, "ACPI"},
      {"an RSDP of revision 1 names no root", 1, 52, 148, 3, 36, false, "ACPI"},
      {"FACP too short for the DSDT", 0, 44, 43, 1, 36, true, "ACPI"},
      {"FACP too short for the wide DSDT", 2, 52, 147, 3, 36, true, "ACPI"},
      {"DSDT shorter than a header", 2, 52, 148, 3, 35, true, "ACPI"},
      {"all of a size", 2, 52, 148, 3, 36, true, "OEMTABLE0,9"},
      {"all of a size, old FACP", 0, 44, 44, 2, 36, true, "OEMTABLE0,9"},
  };
  for (const Row &row : rows) {
    Local local;
    Bytes dsdtBytes = Table("DSDT", row.dsdtLength, row.dsdtLength);
    if (row.dsdtLength >= 28) {
      std::memcpy(&dsdtBytes[16], "OEMTABLE", 8);
      dsdtBytes[24] = 9;
    }
    GuardedBytes dsdt(dsdtBytes);
    Bytes facpBytes = Table("FACP", row.facpLength, std::max<size_t>(row.facpLength, 9));
    facpBytes[8] = row.facpRevision;
    for (auto [offset, width] : {std::pair<size_t, size_t>{40, 4}, {140, 8}}) {
      Bytes field = Address(dsdt.address(), width);
      for (size_t i = 0; i < width && offset + i < facpBytes.size(); i++)
        facpBytes[offset + i] = field[i];
    }
    GuardedBytes facp(facpBytes);
    const size_t width = row.revision == 0 ? 4 : 8;
    Bytes entries = Address(facp.address(), width);
    GuardedBytes root(Table(row.revision == 0 ? "RSDT" : "XSDT", row.rootLength,
                            std::max<size_t>(row.rootLength, 8), entries));
    Bytes rsdpBytes(36, 0);
    std::memcpy(rsdpBytes.data(), "RSD PTR ", 8);
    rsdpBytes[15] = row.revision;
    Bytes address = Address(root.address(), width);
    std::copy(address.begin(), address.end(), rsdpBytes.begin() + (row.revision == 0 ? 16 : 24));
    GuardedBytes rsdp(rsdpBytes);
    local.fw.AddConfigurationTable(gEfiAcpi20TableGuid, reinterpret_cast<void *>(rsdp.address()));
    EXPECT_EQ(reinterpret_cast<UINT64>(nimb::FindFacp()), row.facpFound ? facp.address() : 0) << row.name;
    EXPECT_EQ(local.Init(), row.model) << row.name;
  }
}

}  // namespace
