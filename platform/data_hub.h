// A Data Hub, which the firmware lacks, holding the platform records of the
// configuration (datahub.<name> and datahub-hex.<name>).
//
// The records of the vendor's platform producer come in the order of the
// configuration, with monotonic counts from 1. Behind them stands one record
// of the platform layer's own producer, as a real hub holds records of other
// producers too: a reader that stops at the last record, without looking at
// it, still gets every vendor record.
#pragma once

#include "config.h"
#include "efi/datahub.h"
#include "efi/efi.h"
#include "firmware.h"

namespace nimb::platform {

// The producer of the record that closes the hub.
inline const EFI_GUID gPlatformLayerProducerGuid =
    EFI_GUID_VALUE(0xC513F3A9, 0xB048, 0x4144, 0xAB, 0x0D, 0xE1, 0xF5, 0x04, 0x23, 0x73, 0x4B);

struct PlatformDataHub {
  // First, so that the protocol's `This` is the whole record.
  EFI_DATA_HUB_PROTOCOL protocol;
  // The records one behind the other, each starting at an 8-byte boundary.
  const UINT8 *records;
  UINTN size;
};

// Writes the hub's records for `entries` into `buffer`, when `capacity`
// bytes suffice, and returns the number of bytes they need. A text value
// becomes UCS-2 with a NUL unit; a name always does. `buffer` must be 8-byte
// aligned.
UINTN DataHubBuildRecords(const ConfigEntryList &entries, UINT8 *buffer, UINTN capacity);

// Fills in the protocol over records that DataHubBuildRecords wrote.
// GetNextDataRecord: a count of 0 asks for the first record, any other the
// record of that count; it returns the record and sets the count to the next
// record's, or to 0 with the last. An unknown count gives EFI_NOT_FOUND, and
// so does an empty hub; no filter drivers are known.
void DataHubInit(PlatformDataHub *hub, const UINT8 *records, UINTN size);

// Builds the records in pool memory, initialises `hub` and puts its
// protocol into `slot`.
EFI_STATUS DataHubInstall(PlatformDataHub *hub, const ConfigEntryList &entries, ProtocolSlot slot);

}  // namespace nimb::platform
