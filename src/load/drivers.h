// Drivers of a plain kernel: the driver package, else the driver bundles of
// the extensions directory, placed above the kernel in the kernel region.
#pragma once

#include "efi/efi.h"

namespace nimb {

// The package tried on a disk boot when the first name is not found,
// relative to the boot directory.
inline constexpr const CHAR16 kFallbackDriverPackageName[] = u"nimb_kernel.drvpk";

// Loads the drivers of a plain kernel. Over `loadFile` only the package
// counts; from a volume the bundles stand behind it. An error ends the boot.
EFI_STATUS LoadDrivers(EFI_LOAD_FILE_INTERFACE *loadFile, EFI_FILE *root);

// Copies the package `name` (or the file at `path`), or its 32-bit x86 slice,
// to the top of the kernel region and announces it as "DriversPackage-%qx".
// EFI_NOT_FOUND when the file ends before the slice does.
EFI_STATUS LoadDriverPackage(EFI_LOAD_FILE_INTERFACE *loadFile, EFI_FILE *root, const CHAR16 *name,
                             const EFI_DEVICE_PATH_PROTOCOL *path);

}  // namespace nimb
