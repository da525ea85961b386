#include "data_hub.h"

#include "firmware.h"
#include "support/strings.h"

namespace nimb::platform {

namespace {

UINTN AlignRecord(UINTN size) {
  return (size + 7) & ~static_cast<UINTN>(7);
}

// The size of an entry's name or value as the record holds it.
UINT32 NameSize(const char *name) {
  UINTN units = 0;
  Utf8ToUcs2(name, nullptr, 0, &units);
  return static_cast<UINT32>((units + 1) * sizeof(CHAR16));
}

UINT32 ValueSize(const ConfigEntry &entry) {
  return entry.text ? NameSize(reinterpret_cast<const char *>(entry.bytes)) : entry.size;
}

// Writes a record's header and sizes, and returns where its name goes.
UINT8 *WriteHeader(UINT8 *at, const EFI_GUID &producer, UINT64 count, UINT32 nameSize, UINT32 valueSize) {
  NIMB_PLATFORM_RECORD *record = reinterpret_cast<NIMB_PLATFORM_RECORD *>(at);
  *record = {};
  record->Header.Version = EFI_DATA_RECORD_HEADER_VERSION;
  record->Header.HeaderSize = sizeof(EFI_DATA_RECORD_HEADER);
  record->Header.RecordSize = static_cast<UINT32>(sizeof(NIMB_PLATFORM_RECORD)) + nameSize + valueSize;
  record->Header.ProducerName = producer;
  record->Header.DataRecordClass = EFI_DATA_RECORD_CLASS_DATA;
  record->Header.LogMonotonicCount = count;
  record->NameSize = nameSize;
  record->ValueSize = valueSize;
  return at + sizeof(NIMB_PLATFORM_RECORD);
}

const EFI_DATA_RECORD_HEADER *HeaderAt(const UINT8 *at) {
  return reinterpret_cast<const EFI_DATA_RECORD_HEADER *>(at);
}

EFI_STATUS EFIAPI GetNextDataRecord(EFI_DATA_HUB_PROTOCOL *This, UINT64 *MonotonicCount,
                                    EFI_EVENT *FilterDriver, EFI_DATA_RECORD_HEADER **Record) {
  if (This == nullptr || MonotonicCount == nullptr || Record == nullptr ||
      (FilterDriver != nullptr && *FilterDriver != nullptr)) {
    return EFI_INVALID_PARAMETER;
  }
  const PlatformDataHub *hub = reinterpret_cast<const PlatformDataHub *>(This);
  UINTN offset = 0;
  while (offset < hub->size && *MonotonicCount != 0 &&
         HeaderAt(hub->records + offset)->LogMonotonicCount != *MonotonicCount) {
    offset += AlignRecord(HeaderAt(hub->records + offset)->RecordSize);
  }
  if (offset >= hub->size) {
    return EFI_NOT_FOUND;
  }
  const EFI_DATA_RECORD_HEADER *found = HeaderAt(hub->records + offset);
  const UINTN next = offset + AlignRecord(found->RecordSize);
  *MonotonicCount = next < hub->size ? HeaderAt(hub->records + next)->LogMonotonicCount : 0;
  *Record = const_cast<EFI_DATA_RECORD_HEADER *>(found);
  return EFI_SUCCESS;
}

}  // namespace

UINTN DataHubBuildRecords(const ConfigEntryList &entries, UINT8 *buffer, UINTN capacity) {
  UINTN needed = AlignRecord(sizeof(NIMB_PLATFORM_RECORD));  // the closing record
  for (UINT32 i = 0; i < entries.count; i++) {
    const ConfigEntry &entry = entries.entries[i];
    needed += AlignRecord(sizeof(NIMB_PLATFORM_RECORD) + NameSize(entry.name) + ValueSize(entry));
  }
  if (buffer == nullptr || needed > capacity) {
    return needed;
  }
  UINT8 *at = buffer;
  for (UINT32 i = 0; i < entries.count; i++) {
    const ConfigEntry &entry = entries.entries[i];
    const UINT32 nameSize = NameSize(entry.name);
    const UINT32 valueSize = ValueSize(entry);
    UINT8 *name = WriteHeader(at, gNimbPlatformProducerGuid, i + 1, nameSize, valueSize);
    Utf8ToUcs2(entry.name, reinterpret_cast<CHAR16 *>(name), nameSize / sizeof(CHAR16), nullptr);
    UINT8 *value = name + nameSize;
    if (entry.text) {
      Utf8ToUcs2(reinterpret_cast<const char *>(entry.bytes), reinterpret_cast<CHAR16 *>(value),
                 valueSize / sizeof(CHAR16), nullptr);
    } else {
      memcpy(value, entry.bytes, valueSize);
    }
    const UINTN stride = AlignRecord(sizeof(NIMB_PLATFORM_RECORD) + nameSize + valueSize);
    memset(value + valueSize, 0, stride - (sizeof(NIMB_PLATFORM_RECORD) + nameSize + valueSize));
    at += stride;
  }
  WriteHeader(at, gPlatformLayerProducerGuid, entries.count + 1, 0, 0);
  return needed;
}

void DataHubInit(PlatformDataHub *hub, const UINT8 *records, UINTN size) {
  hub->protocol = {};
  hub->protocol.GetNextDataRecord = GetNextDataRecord;
  hub->records = records;
  hub->size = size;
}

EFI_STATUS DataHubInstall(PlatformDataHub *hub, const ConfigEntryList &entries, ProtocolSlot slot) {
  const UINTN size = DataHubBuildRecords(entries, nullptr, 0);
  void *buffer = nullptr;
  EFI_STATUS status = gBS->AllocatePool(EfiBootServicesData, size, &buffer);
  if (EFI_ERROR(status)) {
    return status;
  }
  DataHubBuildRecords(entries, static_cast<UINT8 *>(buffer), size);
  DataHubInit(hub, static_cast<const UINT8 *>(buffer), size);
  return ProtocolPut(slot, gEfiDataHubProtocolGuid, &hub->protocol);
}

}  // namespace nimb::platform
