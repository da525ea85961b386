// The platform layer's view of the firmware: its tables, kept at entry, and
// the few definitions that the shared EFI header leaves as untyped slots.
#pragma once

#include "efi/efi.h"

namespace nimb::platform {

extern EFI_SYSTEM_TABLE *gST;
extern EFI_BOOT_SERVICES *gBS;
extern EFI_RUNTIME_SERVICES *gRT;
extern EFI_HANDLE gImageHandle;

// Boot services slots that efi.h types as `void *`.
typedef EFI_STATUS(EFIAPI *EFI_IMAGE_UNLOAD)(EFI_HANDLE ImageHandle);

// A file path media node: the header, then the UCS-2 path with its NUL.
struct FILEPATH_DEVICE_PATH {
  EFI_DEVICE_PATH_PROTOCOL Header;
  CHAR16 PathName[1];
};

// Room for a file's EFI_FILE_INFO with a name of up to 511 characters.
constexpr UINTN kFileInfoBufferSize = SIZE_OF_EFI_FILE_INFO + 512 * sizeof(CHAR16);

}  // namespace nimb::platform
