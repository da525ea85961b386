// What machine the platform runs on: QEMU is told by the system manufacturer
// of its SMBIOS tables ("QEMU", QEMU's own default), which other machines,
// virtual ones under other monitors included, don't give.
#pragma once

#include "efi/efi.h"

namespace nimb::platform {

// The system manufacturer of an SMBIOS structure table of `size` bytes (the
// string of the first type 1 structure) is `name`. False for a table without
// a type 1 structure, without the string, or cut off.
bool SmbiosManufacturerIs(const UINT8 *table, UINTN size, const char *name);

// The firmware's SMBIOS tables (3.x entry point first, else 2.x) name QEMU as
// the manufacturer.
bool MachineIsQemu();

}  // namespace nimb::platform
