// Loading the kernel image.
#pragma once

#include "efi/efi.h"

namespace nimb {

// Places the kernel named by gKernelName at its addresses and sets
// gKernelEntry. Files come from `loadFile` when it is set, else from `root`.
EFI_STATUS LoadKernelFile(EFI_LOAD_FILE_INTERFACE *loadFile, EFI_FILE *root);

}  // namespace nimb
