// ACPI tables as firmware leaves them for the operating system: in ACPI
// reclaim memory (the FACS in ACPI NVS memory), below 4 GiB, with their
// checksums right, and announced through the configuration table.
#include <algorithm>
#include <cstring>

#include "hostfw/internal.h"

namespace hostfw {

namespace {

constexpr size_t kHeaderSize = 36;
constexpr size_t kRsdpSize1 = 20;  // the first version's RSDP
constexpr size_t kRsdpSize2 = 36;
constexpr size_t kFacsSize = 64;
constexpr size_t kFacpSize1 = 116;  // up to revision 2
constexpr size_t kFacpSize2 = 244;  // above
constexpr size_t kDsdtSize = kHeaderSize + 8;
constexpr size_t kAlign = 16;

// FACP fields.
constexpr size_t kFacpFirmwareCtrl = 36;
constexpr size_t kFacpDsdt = 40;
constexpr size_t kFacpFirmwareCtrl64 = 132;
constexpr size_t kFacpDsdt64 = 140;

void Put32(uint8_t *at, UINT32 value) {
  std::memcpy(at, &value, sizeof(value));
}

void Put64(uint8_t *at, UINT64 value) {
  std::memcpy(at, &value, sizeof(value));
}

// Makes the bytes [0, length) sum to 0 through the byte at `field`.
void Checksum(uint8_t *table, size_t length, size_t field) {
  table[field] = 0;
  uint8_t sum = 0;
  for (size_t i = 0; i < length; i++)
    sum = uint8_t(sum + table[i]);
  table[field] = uint8_t(-sum);
}

// The 36-byte header that every table but the RSDP and FACS starts with.
void PutHeader(uint8_t *table, const std::string &signature, UINT32 length, UINT8 revision,
               const std::string &oemTableId, UINT32 oemRevision) {
  std::memcpy(table, signature.data(), 4);
  Put32(table + 4, length);
  table[8] = revision;
  std::memcpy(table + 10, "NIMBFW", 6);
  std::memset(table + 16, ' ', 8);
  std::memcpy(table + 16, oemTableId.data(), std::min<size_t>(oemTableId.size(), 8));
  Put32(table + 24, oemRevision);
  std::memcpy(table + 28, "HFWC", 4);  // creator id
  Put32(table + 32, 1);                // creator revision
}

// Finishes a table of `space` bytes whose header states `length`.
void Seal(uint8_t *table, size_t space, UINT32 length) {
  Put32(table + 4, length);
  Checksum(table, std::min<size_t>(length, space), 9);
}

size_t Aligned(size_t offset) {
  return (offset + kAlign - 1) / kAlign * kAlign;
}

}  // namespace

AcpiTables Firmware::InstallAcpi(const AcpiOptions &options) {
  State &s = *s_;
  for (const std::string &signature : options.otherTables) {
    if (signature.size() != 4)
      Misuse("InstallAcpi: a table signature has 4 characters, not \"%s\"", signature.c_str());
  }
  if (options.oemTableId.size() > 8)
    Misuse("InstallAcpi: an OEM table id has at most 8 characters");

  const bool extended = options.rsdpRevision >= 2;
  const size_t entries = options.otherTables.size() + (options.facp ? 1 : 0);
  const size_t facpSize =
      std::max<size_t>(options.facpRevision > 2 ? kFacpSize2 : kFacpSize1, options.facpLength);
  const size_t dsdtSize = std::max<size_t>(kDsdtSize, options.dsdtLength);

  // Where each table goes in the reclaim region.
  size_t offset = 0;
  auto place = [&](size_t size) {
    size_t at = Aligned(offset);
    offset = at + size;
    return at;
  };
  const size_t rsdpAt = place(extended ? kRsdpSize2 : kRsdpSize1);
  const size_t rsdtSize = kHeaderSize + 4 * entries;
  const size_t rsdtAt = place(std::max<size_t>(rsdtSize, options.rsdtLength));
  const size_t xsdtSize = kHeaderSize + 8 * entries;
  const size_t xsdtAt = extended ? place(std::max<size_t>(xsdtSize, options.xsdtLength)) : 0;
  const size_t facpAt = place(facpSize);
  const size_t dsdtAt = place(dsdtSize);
  std::vector<size_t> otherAt;
  for (size_t i = 0; i < options.otherTables.size(); i++)
    otherAt.push_back(place(kHeaderSize));

  const UINT64 base = AllocateFirmwarePages(s, EfiACPIReclaimMemory, EFI_SIZE_TO_PAGES(offset), 0);
  const UINT64 facsBase = AllocateFirmwarePages(s, EfiACPIMemoryNVS, 1, 0);
  auto *bytes = reinterpret_cast<uint8_t *>(base);

  AcpiTables tables;
  tables.rsdp = base + rsdpAt;
  tables.rsdt = base + rsdtAt;
  tables.xsdt = extended ? base + xsdtAt : 0;
  tables.facp = base + facpAt;
  tables.facs = facsBase;
  tables.dsdt = base + dsdtAt;

  // FACS: signature, length, hardware signature, version.
  auto *facs = reinterpret_cast<uint8_t *>(facsBase);
  std::memcpy(facs, "FACS", 4);
  Put32(facs + 4, kFacsSize);
  Put32(facs + 8, options.hardwareSignature);
  facs[32] = 2;

  // DSDT: the header and a few bytes of an empty definition block.
  uint8_t *dsdt = bytes + dsdtAt;
  std::string oemTableId = options.oemTableId;
  oemTableId.resize(8, ' ');
  PutHeader(dsdt, "DSDT", 0, 2, oemTableId, options.oemRevision);
  std::memcpy(dsdt + kHeaderSize, "\x10\x06\x5C\x5F\x53\x42\x5F\x00", 8);  // Scope (\_SB_)
  Seal(dsdt, dsdtSize, options.dsdtLength != 0 ? options.dsdtLength : UINT32(kDsdtSize));

  // FACP.
  uint8_t *facp = bytes + facpAt;
  PutHeader(facp, "FACP", 0, options.facpRevision, "NIMBFACP", 1);
  Put32(facp + kFacpFirmwareCtrl, UINT32(tables.facs));
  if (options.dsdt32)
    Put32(facp + kFacpDsdt, UINT32(tables.dsdt));
  if (facpSize >= kFacpDsdt64 + 8) {
    Put64(facp + kFacpFirmwareCtrl64, tables.facs);
    if (options.dsdt64)
      Put64(facp + kFacpDsdt64, tables.dsdt);
  }
  const UINT32 facpLength = options.facpLength != 0
                                ? options.facpLength
                                : UINT32(options.facpRevision > 2 ? kFacpSize2 : kFacpSize1);
  Seal(facp, facpSize, facpLength);

  for (size_t i = 0; i < options.otherTables.size(); i++) {
    PutHeader(bytes + otherAt[i], options.otherTables[i], 0, 1, "NIMBTABL", 1);
    Seal(bytes + otherAt[i], kHeaderSize, kHeaderSize);
  }

  // The root tables list the other tables, then the FACP.
  std::vector<UINT64> listed;
  for (size_t at : otherAt)
    listed.push_back(base + at);
  if (options.facp)
    listed.push_back(tables.facp);
  uint8_t *rsdt = bytes + rsdtAt;
  PutHeader(rsdt, "RSDT", 0, 1, "NIMBRSDT", 1);
  for (size_t i = 0; i < listed.size(); i++)
    Put32(rsdt + kHeaderSize + 4 * i, UINT32(listed[i]));
  Seal(rsdt, std::max<size_t>(rsdtSize, options.rsdtLength),
       options.rsdtLength != 0 ? options.rsdtLength : UINT32(rsdtSize));
  if (extended) {
    uint8_t *xsdt = bytes + xsdtAt;
    PutHeader(xsdt, "XSDT", 0, 1, "NIMBXSDT", 1);
    for (size_t i = 0; i < listed.size(); i++)
      Put64(xsdt + kHeaderSize + 8 * i, listed[i]);
    Seal(xsdt, std::max<size_t>(xsdtSize, options.xsdtLength),
         options.xsdtLength != 0 ? options.xsdtLength : UINT32(xsdtSize));
  }

  // RSDP: signature, checksum of the first 20 bytes, OEM id, revision, RSDT;
  // from revision 2 on also length, XSDT and the checksum of all 36 bytes.
  uint8_t *rsdp = bytes + rsdpAt;
  std::memcpy(rsdp, "RSD PTR ", 8);
  std::memcpy(rsdp + 9, "NIMBFW", 6);
  rsdp[15] = options.rsdpRevision;
  if (options.rsdt)
    Put32(rsdp + 16, UINT32(tables.rsdt));
  if (extended) {
    Put32(rsdp + 20, kRsdpSize2);
    if (options.xsdt)
      Put64(rsdp + 24, tables.xsdt);
  }
  Checksum(rsdp, kRsdpSize1, 8);
  if (extended)
    Checksum(rsdp, kRsdpSize2, 32);

  for (const EFI_GUID &guid : options.configurationGuids)
    AddConfigurationTable(guid, rsdp);
  return tables;
}

}  // namespace hostfw
