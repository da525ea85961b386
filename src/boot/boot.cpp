#include "boot/boot.h"

#include "boot/bootinfo.h"
#include "boot/gate.h"
#include "boot/handoff.h"
#include "boot/machine.h"
#include "boot/stop.h"
#include "boot/volume.h"
#include "config/boot_options.h"
#include "devicetree/platform.h"
#include "load/drivers.h"
#include "load/kernel.h"
#include "load/kernel_cache.h"
#include "memory/tracking.h"
#include "resume/resume.h"
#include "screen/bootscreen.h"
#include "screen/console.h"
#include "screen/spinner.h"

namespace nimb {

EFI_SYSTEM_TABLE *gST;
EFI_BOOT_SERVICES *gBS;
EFI_RUNTIME_SERVICES *gRT;
EFI_HANDLE gImageHandle;
EFI_LOADED_IMAGE_PROTOCOL *gLoadedImage;
EFI_DEVICE_PATH_PROTOCOL *gBootDevicePath;
UINT64 gCallGate;
UINT64 gKernelEntry;

void ExitBoot(EFI_STATUS status) {
  // A resume under way has no way back to the firmware: it resets.
  ResumeResetExit();
  if (gSpinnerEvent != nullptr) {
    gBS->CloseEvent(gSpinnerEvent);
    gSpinnerEvent = nullptr;
  }
  RestoreConsoleMode();
  DrawFailureScreen();
  TrackedFreeAll();
  gBS->Exit(gImageHandle, status, 0, nullptr);
  // Exit does not come back to an application; should it, there is nothing
  // left to return to.
  MachineHalt();
}

// The boot sequence, from the firmware's entry to the kernel's. It runs once,
// top to bottom; every step that cannot go on ends the run through Fatal.
static EFI_STATUS Boot(EFI_HANDLE imageHandle, EFI_SYSTEM_TABLE *systemTable) {
  gST = systemTable;
  gBS = systemTable->BootServices;
  gRT = systemTable->RuntimeServices;
  gImageHandle = imageHandle;

  if (EFI_ERROR(InitConsole())) {
    Fatal("Can not initialize console\n");
  }

  // The device tree starts here; all later tree work depends on it.
  InitPlatformDescription();

  EFI_STATUS status = CopyCallGate();
  if (EFI_ERROR(status)) {
    Fatal("Could not allocate kernel call gate (%x)\n", status);
  }

  // A hibernated image asked for: restarted from in here, or a reset.
  TryResume();

  if (EFI_ERROR(gBS->HandleProtocol(gImageHandle, &gEfiLoadedImageProtocolGuid,
                                    reinterpret_cast<void **>(&gLoadedImage))) ||
      gLoadedImage == nullptr) {
    Fatal("Can not retrieve a LoadedImageProtocol handle for ImageHandle\n");
  }

  if (EFI_ERROR(gBS->HandleProtocol(gLoadedImage->DeviceHandle, &gEfiDevicePathProtocolGuid,
                                    reinterpret_cast<void **>(&gBootDevicePath))) ||
      gBootDevicePath == nullptr) {
    Fatal("Can not find a DevicePath handle for LoadedImage->DeviceHandle\n");
  }

  CHAR16 *options = CopyLoadOptions(gLoadedImage);
  BootVolume volume = OpenBootVolume(gLoadedImage->DeviceHandle);

  ProcessBootOptions(volume.loadFile, volume.root, options, &gBootOptions);

  // The first change of the screen, after the options, so that a verbose
  // boot never shows the logo.
  if (gBootFlags & kBootVerbose) {
    SetConsoleMode(kConsoleText);
  } else {
    ShowBootScreen();
  }

  // The kernel cache holds the kernel and its drivers; it is only read from
  // a volume. Whatever stops it, the plain kernel brings its drivers.
  bool useDrivers = false;
  if (volume.loadFile != nullptr || EFI_ERROR(LoadKernelCache(nullptr, volume.root))) {
    useDrivers = true;
    if (EFI_ERROR(LoadKernelFile(volume.loadFile, volume.root))) {
      Fatal("Error loading kernel '%S'\n", gKernelName);
    }
  }

  // The record goes to the top of the kernel region, which exists only now.
  InitBootInfo(gLoadedImage, gBootOptions);

  if (useDrivers && EFI_ERROR(LoadDrivers(volume.loadFile, volume.root))) {
    Fatal("Error loading drivers\n");
  }

  if (gSpinnerEvent != nullptr) {
    StopSpinner();
  }

  UINTN mapKey = 0;
  FinishBootInfo(&mapKey, gBootOptions);

  // Boot services are gone. Nothing but the arguments' loading stands between
  // the interrupts going off and the call. The gate does not come back; should
  // it, there is no console left to say so.
  MachineDisableInterrupts();
  MachineEnterGate(gCallGate, reinterpret_cast<UINT64>(bootArgs), gKernelEntry);
  StopAfterBootServices("Kernel entry failed\n", FALSE);
}

}  // namespace nimb

extern "C" EFI_STATUS EFIAPI BootEntry(EFI_HANDLE ImageHandle, EFI_SYSTEM_TABLE *SystemTable) {
  return nimb::Boot(ImageHandle, SystemTable);
}
