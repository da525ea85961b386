#include "devicetree/platform.h"

#include "boot/boot.h"
#include "devicetree/devicetree.h"
#include "efi/datahub.h"
#include "memory/tracking.h"
#include "screen/console.h"
#include "support/strings.h"
#include "support/text.h"

namespace nimb {

char gModelName[64];

// ACPI tables, by the offsets the loader reads. Every table starts with a
// 36-byte header whose length field covers the whole table.
constexpr UINT32 kAcpiHeaderSize = 36;
constexpr UINTN kAcpiTableLength = 4;
constexpr UINTN kRsdpRevision = 15;
constexpr UINTN kRsdpRsdtAddress = 16;
constexpr UINTN kRsdpXsdtAddress = 24;
constexpr UINTN kFacpRevision = 8;
constexpr UINTN kFacpFirmwareCtrl = 36;
constexpr UINTN kFacpDsdtAddress = 40;
constexpr UINTN kFacpFirmwareCtrl64 = 132;
constexpr UINTN kFacpDsdtAddress64 = 140;
constexpr UINTN kDsdtOemTableId = 16;
constexpr UINTN kDsdtOemRevision = 24;
constexpr UINTN kOemTableIdSize = 8;
constexpr UINTN kFacsHardwareSignature = 8;
// From this revision of the FACP on, the DSDT is addressed by its 64-bit field.
constexpr UINT8 kFacpRevisionWide = 3;

// Table fields are not aligned: read them a byte at a time.
static UINT32 Read32(const UINT8 *bytes) {
  return static_cast<UINT32>(bytes[0]) | static_cast<UINT32>(bytes[1]) << 8 |
         static_cast<UINT32>(bytes[2]) << 16 | static_cast<UINT32>(bytes[3]) << 24;
}

static UINT64 Read64(const UINT8 *bytes) {
  return static_cast<UINT64>(Read32(bytes)) | static_cast<UINT64>(Read32(bytes + 4)) << 32;
}

static const UINT8 *TableAt(UINT64 address) {
  return reinterpret_cast<const UINT8 *>(static_cast<UINTN>(address));
}

// A table's length, or 0 for a table too short to have a whole header.
static UINT32 TableLength(const UINT8 *table) {
  const UINT32 length = Read32(table + kAcpiTableLength);
  return length < kAcpiHeaderSize ? 0 : length;
}

// Copies one platform record into `platform`. Records of other producers
// are skipped, and so is a record whose name and value run past the size
// the hub gives for it, or whose name buffer cannot be had.
static void AddPlatformRecord(DeviceTreeNode *platform, const EFI_DATA_RECORD_HEADER *header) {
  const UINT64 recordSize = header->RecordSize;
  if (recordSize < sizeof(NIMB_PLATFORM_RECORD) ||
      !CompareGuid(&header->ProducerName, &gNimbPlatformProducerGuid)) {
    return;
  }
  const NIMB_PLATFORM_RECORD *record = reinterpret_cast<const NIMB_PLATFORM_RECORD *>(header);
  const UINT64 nameSize = record->NameSize;
  const UINT64 valueSize = record->ValueSize;
  if (nameSize + valueSize > recordSize - sizeof(NIMB_PLATFORM_RECORD)) {
    return;
  }
  // Each UCS-2 unit takes at most three bytes of UTF-8.
  const UINT64 bufferSize = nameSize * 3 + 1;
  if (bufferSize > 0xFFFFFFFFULL) {
    return;
  }
  char *name = static_cast<char *>(TrackedAllocatePool(bufferSize));
  if (name == nullptr) {
    return;
  }
  const UINT8 *data = reinterpret_cast<const UINT8 *>(record + 1);
  UcsToUtf8(reinterpret_cast<const UINT16 *>(data), static_cast<INT32>(nameSize / 2),
            reinterpret_cast<UINT8 *>(name), static_cast<UINT32>(bufferSize), 1);
  // The tree keeps the name by pointer, and copies the value, which is the
  // firmware's.
  if (DeviceTreeAddProperty(platform, name, valueSize, data + nameSize, 1) == nullptr) {
    TrackedFree(name);
  }
}

EFI_STATUS InitPlatformDescription() {
  DeviceTreeInit();
  if (DeviceTreeFindNode("/", 1) == nullptr) {
    Fatal("Couldn't create root node");
  }
  DeviceTreeNode *platform = DeviceTreeFindNode("/efi/platform", 1);
  if (platform == nullptr) {
    return EFI_SUCCESS;
  }
  EFI_DATA_HUB_PROTOCOL *hub = nullptr;
  if (EFI_ERROR(gBS->LocateProtocol(&gEfiDataHubProtocolGuid, nullptr, reinterpret_cast<void **>(&hub))) ||
      hub == nullptr) {
    return EFI_SUCCESS;
  }
  UINT64 count = 0;
  for (;;) {
    EFI_DATA_RECORD_HEADER *record = nullptr;
    if (EFI_ERROR(hub->GetNextDataRecord(hub, &count, nullptr, &record))) {
      break;
    }
    // The hub returns 0 together with its last record, which is thus never
    // looked at.
    if (count == 0) {
      break;
    }
    if (record != nullptr) {
      AddPlatformRecord(platform, record);
    }
  }
  return EFI_SUCCESS;
}

const UINT8 *FindFacp() {
  // A 2.0 entry ends the search; a 1.0 entry is kept until a later entry
  // replaces it.
  const UINT8 *rsdp = nullptr;
  const EFI_CONFIGURATION_TABLE *entries = gST->ConfigurationTable;
  for (UINTN i = 0; entries != nullptr && i < gST->NumberOfTableEntries; i++) {
    if (entries[i].VendorTable == nullptr) {
      continue;
    }
    if (CompareGuid(&entries[i].VendorGuid, &gEfiAcpi20TableGuid)) {
      rsdp = static_cast<const UINT8 *>(entries[i].VendorTable);
      break;
    }
    if (CompareGuid(&entries[i].VendorGuid, &gEfiAcpi10TableGuid)) {
      rsdp = static_cast<const UINT8 *>(entries[i].VendorTable);
    }
  }
  if (rsdp == nullptr) {
    return nullptr;
  }

  // The RSDP's own revision says which root table to read, whatever GUID
  // it was found under.
  UINT64 root;
  UINTN entrySize;
  const UINT8 revision = rsdp[kRsdpRevision];
  if (revision == 0) {
    root = Read32(rsdp + kRsdpRsdtAddress);
    entrySize = 4;
  } else if (revision == 1) {
    return nullptr;
  } else {
    root = Read64(rsdp + kRsdpXsdtAddress);
    entrySize = 8;
  }
  if (root == 0) {
    return nullptr;
  }
  const UINT8 *rootTable = TableAt(root);
  const UINT32 length = TableLength(rootTable);
  if (length == 0) {
    return nullptr;
  }
  const UINTN count = (length - kAcpiHeaderSize) / entrySize;
  for (UINTN i = 0; i < count; i++) {
    const UINT8 *entry = rootTable + kAcpiHeaderSize + i * entrySize;
    const UINT64 address = entrySize == 4 ? Read32(entry) : Read64(entry);
    if (address == 0) {
      continue;
    }
    const UINT8 *table = TableAt(address);
    if (table[0] == 'F' && table[1] == 'A' && table[2] == 'C' && table[3] == 'P') {
      return table;
    }
  }
  return nullptr;
}

const UINT8 *FindFacs() {
  const UINT8 *facp = FindFacp();
  if (facp == nullptr) {
    return nullptr;
  }
  // Fields beyond the table's stated length are not read.
  const UINT32 length = TableLength(facp);
  UINT64 address = 0;
  if (facp[kFacpRevision] >= kFacpRevisionWide && length >= kFacpFirmwareCtrl64 + 8) {
    address = Read64(facp + kFacpFirmwareCtrl64);
  }
  if (address == 0 && length >= kFacpFirmwareCtrl + 4) {
    address = Read32(facp + kFacpFirmwareCtrl);
  }
  return address != 0 ? TableAt(address) : nullptr;
}

UINT32 FacsHardwareSignature(const UINT8 *facs) {
  return Read32(facs + kFacsHardwareSignature);
}

// The DSDT that the FACP names, or null when the FACP is too short for the
// field its revision asks for, or the field is 0.
static const UINT8 *DsdtOf(const UINT8 *facp) {
  const UINT32 length = TableLength(facp);
  if (length == 0) {
    return nullptr;
  }
  UINT64 address = 0;
  if (facp[kFacpRevision] >= kFacpRevisionWide) {
    if (length >= kFacpDsdtAddress64 + 8) {
      address = Read64(facp + kFacpDsdtAddress64);
    }
  } else if (length >= kFacpDsdtAddress + 4) {
    address = Read32(facp + kFacpDsdtAddress);
  }
  return address != 0 ? TableAt(address) : nullptr;
}

// The model text from the "Model" platform record: UCS-2, with or without a
// terminating NUL unit.
static void ModelFromRecord(const DeviceTreeProperty *model) {
  const UINT8 *value = static_cast<const UINT8 *>(model->value);
  UINT32 units = model->length / 2;
  if (units > 0 && value[2 * units - 2] == 0 && value[2 * units - 1] == 0) {
    units--;
  }
  UcsToUtf8(static_cast<const UINT16 *>(model->value), static_cast<INT32>(units),
            reinterpret_cast<UINT8 *>(gModelName), sizeof(gModelName), 1);
}

// The model text from the DSDT: its OEM table id up to the first blank or
// NUL, then its OEM revision as "major,minor".
static void ModelFromDsdt() {
  const UINT8 *facp = FindFacp();
  if (facp == nullptr) {
    return;
  }
  const UINT8 *dsdt = DsdtOf(facp);
  if (dsdt == nullptr || TableLength(dsdt) == 0) {
    return;
  }
  memcpy(gModelName, dsdt + kDsdtOemTableId, kOemTableIdSize);
  UINTN end = 0;
  while (end < kOemTableIdSize && gModelName[end] != ' ' && gModelName[end] != '\0') {
    end++;
  }
  const UINT32 revision = Read32(dsdt + kDsdtOemRevision);
  sprintf(gModelName + end, "%d,%d", static_cast<UINT64>(revision >> 16),
          static_cast<UINT64>(revision & 0xFFFF));
}

const char *GetModelName() {
  if (gModelName[0] != '\0') {
    return gModelName;
  }
  DeviceTreeNode *platform = DeviceTreeFindNode("/efi/platform", 0);
  const DeviceTreeProperty *model = DeviceTreeFindProperty(platform, "Model");
  // A "Model" record decides, even one that converts to nothing.
  if (model != nullptr && model->length != 0 && model->value != nullptr) {
    ModelFromRecord(model);
  } else {
    ModelFromDsdt();
  }
  if (gModelName[0] == '\0') {
    strcpy(gModelName, "ACPI");
  }
  return gModelName;
}

}  // namespace nimb
