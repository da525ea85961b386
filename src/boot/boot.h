// The boot driver: the firmware's entry, the program-wide identity of the
// run, and the way out of a failed boot.
#pragma once

#include "efi/efi.h"

namespace nimb {

extern EFI_SYSTEM_TABLE *gST;
extern EFI_BOOT_SERVICES *gBS;
extern EFI_RUNTIME_SERVICES *gRT;
extern EFI_HANDLE gImageHandle;
extern EFI_LOADED_IMAGE_PROTOCOL *gLoadedImage;
extern EFI_DEVICE_PATH_PROTOCOL *gBootDevicePath;
extern UINT64 gCallGate;
extern UINT64 gKernelEntry;

// Closes the spinner, restores the console, draws the failure picture,
// returns all tracked memory and leaves for the firmware with `status`.
[[noreturn]] void ExitBoot(EFI_STATUS status);

}  // namespace nimb

// The firmware's entry point. It does not return in the course of a boot.
extern "C" EFI_STATUS EFIAPI BootEntry(EFI_HANDLE ImageHandle, EFI_SYSTEM_TABLE *SystemTable);
