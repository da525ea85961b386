// The firmware's Data Hub, where it logs records about the machine, and the
// layout of the vendor's platform records in it.
#pragma once

#include "efi/efi.h"

// The standard header that starts every record of the hub.
struct EFI_DATA_RECORD_HEADER {
  UINT16 Version;
  UINT16 HeaderSize;
  UINT32 RecordSize;  // of the whole record, this header included
  EFI_GUID DataRecordGuid;
  EFI_GUID ProducerName;
  UINT64 DataRecordClass;
  EFI_TIME LogTime;
  UINT64 LogMonotonicCount;
};

#define EFI_DATA_RECORD_HEADER_VERSION 0x0100
#define EFI_DATA_RECORD_CLASS_DATA 0x0000000000000010ULL

struct EFI_DATA_HUB_PROTOCOL {
  void *LogData;
  // `*MonotonicCount` 0 asks for the first record. On return it holds the
  // count of the record after the one delivered, or 0 when that was the last.
  EFI_STATUS(EFIAPI *GetNextDataRecord)
  (EFI_DATA_HUB_PROTOCOL *This, UINT64 *MonotonicCount, EFI_EVENT *FilterDriver,
   EFI_DATA_RECORD_HEADER **Record);
  void *RegisterFilterDriver;
  void *UnregisterFilterDriver;
};

inline const EFI_GUID gEfiDataHubProtocolGuid =
    EFI_GUID_VALUE(0xAE80D021, 0x618E, 0x11D4, 0xBC, 0xD7, 0x00, 0x80, 0xC7, 0x3C, 0x88, 0x81);

// The producer under which the vendor's firmware logs its platform facts.
inline const EFI_GUID gNimbPlatformProducerGuid =
    EFI_GUID_VALUE(0x64517CC8, 0x6561, 0x4051, 0xB0, 0x3C, 0x59, 0x64, 0xB6, 0x0F, 0x4C, 0x7A);

// A platform record of that producer: behind the standard header, 16 bytes
// of the producer's own that nobody reads, the sizes, then the name (UCS-2)
// and the value (raw bytes), one behind the other.
struct NIMB_PLATFORM_RECORD {
  EFI_DATA_RECORD_HEADER Header;
  UINT8 Reserved[16];
  UINT32 NameSize;   // in bytes
  UINT32 ValueSize;  // in bytes
};

static_assert(sizeof(EFI_DATA_RECORD_HEADER) == 72);
static_assert(offsetof(EFI_DATA_RECORD_HEADER, RecordSize) == 4);
static_assert(offsetof(EFI_DATA_RECORD_HEADER, DataRecordGuid) == 8);
static_assert(offsetof(EFI_DATA_RECORD_HEADER, ProducerName) == 24);
static_assert(offsetof(EFI_DATA_RECORD_HEADER, DataRecordClass) == 40);
static_assert(offsetof(EFI_DATA_RECORD_HEADER, LogTime) == 48);
static_assert(offsetof(EFI_DATA_RECORD_HEADER, LogMonotonicCount) == 64);
static_assert(offsetof(EFI_DATA_HUB_PROTOCOL, GetNextDataRecord) == 8, "the second entry");
static_assert(offsetof(NIMB_PLATFORM_RECORD, NameSize) == 88);
static_assert(offsetof(NIMB_PLATFORM_RECORD, ValueSize) == 92);
static_assert(sizeof(NIMB_PLATFORM_RECORD) == 96, "the name follows at 96");
