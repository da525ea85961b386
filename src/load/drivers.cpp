#include "load/drivers.h"

#include "config/boot_options.h"
#include "load/bootfile.h"
#include "load/bundles.h"
#include "load/kernel.h"
#include "load/kernel_cache.h"
#include "memory/kernel_region.h"
#include "memory/tracking.h"
#include "screen/console.h"

namespace nimb {

// Whether the package of the boot options is worth a try. Over LoadFile it
// is the only source; from a volume it must be a file, and (unless the user
// named it) stand exactly one second after the extensions directory, when
// there is one, outside safe mode.
static bool ShouldTryDriverPackage(EFI_LOAD_FILE_INTERFACE *loadFile, EFI_FILE *root) {
  if (loadFile != nullptr) {
    return true;
  }
  if (root == nullptr || gDriverPackageName == nullptr || gKernelName == nullptr) {
    return false;
  }
  EFI_FILE *handle = nullptr;
  if (EFI_ERROR(root->Open(root, &handle, gDriverPackageName, EFI_FILE_MODE_READ, 0))) {
    return false;
  }
  if (gCustomDriverPackage) {
    handle->Close(handle);
    return true;
  }
  EFI_FILE_INFO *package = nullptr;
  EFI_STATUS status = BootFileGetInfo(handle, &package);
  handle->Close(handle);
  if (EFI_ERROR(status)) {
    return false;
  }
  bool result = false;
  EFI_FILE_INFO *extensions = nullptr;
  if ((package->Attribute & EFI_FILE_DIRECTORY) == 0 &&
      !EFI_ERROR(root->Open(root, &handle, gKernelName, EFI_FILE_MODE_READ, 0))) {
    handle->Close(handle);
    status = root->Open(root, &handle, kExtensionsPath, EFI_FILE_MODE_READ, 0);
    if (status == EFI_NOT_FOUND) {
      result = true;
    } else if (!EFI_ERROR(status)) {
      status = BootFileGetInfo(handle, &extensions);
      handle->Close(handle);
      if (!EFI_ERROR(status)) {
        result = (extensions->Attribute & EFI_FILE_DIRECTORY) == 0 ||
                 ((gBootFlags & kBootSafeMode) == 0 && IsOneSecondAfter(extensions, package));
        TrackedFree(extensions);
      }
    }
  }
  TrackedFree(package);
  return result;
}

EFI_STATUS LoadDrivers(EFI_LOAD_FILE_INTERFACE *loadFile, EFI_FILE *root) {
  printf("Loading drivers...\n");
  EFI_STATUS status = EFI_NOT_FOUND;
  if (ShouldTryDriverPackage(loadFile, root)) {
    status = LoadDriverPackage(loadFile, root, gDriverPackageName, gDriverPackagePath);
    if (status == EFI_NOT_FOUND && loadFile == nullptr) {
      status = LoadDriverPackage(nullptr, root, kFallbackDriverPackageName, nullptr);
    }
  }
  if (status != EFI_SUCCESS && loadFile == nullptr) {
    status = ScanDriverBundles(root, kExtensionsPath, 1);
    WalkDriverLibraries();
    StageDrivers(root);
  }
  return status;
}

// Copies the slice at the file's position to the top of the kernel region.
static EFI_STATUS PlaceDriverPackage(BootFile *file, UINT64 size) {
  UINT64 address = gKernelRegionTop;
  UINT64 rounded = size;
  if (AllocateKernelPages(&address, &rounded) == 0) {
    return EFI_OUT_OF_RESOURCES;
  }
  gKernelRegionTop += rounded;
  UINT64 count = size;
  EFI_STATUS status = BootFileRead(file, &count, reinterpret_cast<void *>(address));
  if (EFI_ERROR(status)) {
    return status;
  }
  if (count != size) {
    return EFI_NOT_FOUND;
  }
  char name[32];
  sprintf(name, "DriversPackage-%qx", address);
  AddMemoryRange(name, address, size, 2);
  return EFI_SUCCESS;
}

EFI_STATUS LoadDriverPackage(EFI_LOAD_FILE_INTERFACE *loadFile, EFI_FILE *root, const CHAR16 *name,
                             const EFI_DEVICE_PATH_PROTOCOL *path) {
  printf("Loading %S...\n", name);
  BootFile file;
  if (path != nullptr) {
    BootFileOpenDevicePath(loadFile, path, &file);
  } else {
    // Boot options that could not be settled leave no name to open.
    EFI_STATUS status = name != nullptr ? BootFileOpen(loadFile, root, name, &file) : EFI_INVALID_PARAMETER;
    if (EFI_ERROR(status)) {
      printf("Could not open file '%S'\n", name);
      return status;
    }
  }
  UINT64 size = 0;
  UINT64 offset = 0;
  EFI_STATUS status = BootFileFindSlice(&file, &size, &offset);
  if (!EFI_ERROR(status)) {
    status = PlaceDriverPackage(&file, size);
  }
  BootFileClose(&file);
  return status;
}

}  // namespace nimb
