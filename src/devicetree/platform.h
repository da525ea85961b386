// What the firmware knows about the machine: the vendor's platform records
// in /efi/platform, the ACPI fixed description table, the model name.
#pragma once

#include "efi/efi.h"

namespace nimb {

// The model text: 64 bytes, worked out once.
extern char gModelName[64];

// Starts the device tree and copies the vendor's Data Hub records into
// /efi/platform. Always 0.
EFI_STATUS InitPlatformDescription();
// The ACPI fixed description table ("FACP"), or null.
const UINT8 *FindFacp();
// The ACPI firmware control structure ("FACS") that the FACP names: by its
// 64-bit field from FACP revision 3 on, by the 32-bit field when that one is
// 0 or the revision is lower. Null without a FACP or an address.
const UINT8 *FindFacs();
// The hardware signature at offset 8 of a FACS.
UINT32 FacsHardwareSignature(const UINT8 *facs);
// The short model text; never null, never empty.
const char *GetModelName();

}  // namespace nimb
