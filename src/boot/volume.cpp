#include "boot/volume.h"

#include "boot/boot.h"
#include "config/boot_options.h"
#include "memory/tracking.h"
#include "screen/console.h"
#include "support/sprint.h"

namespace nimb {

CHAR16 *CopyLoadOptions(const EFI_LOADED_IMAGE_PROTOCOL *image) {
  const CHAR16 *text = static_cast<const CHAR16 *>(image->LoadOptions);
  UINTN units = text != nullptr ? image->LoadOptionsSize / sizeof(CHAR16) : 0;
  UINTN start = 0;
  while (start < units && (text[start] == u' ' || text[start] == u'\t')) {
    start++;
  }
  // The text ends at its size or at a zero character, whichever comes first.
  UINTN end = start;
  while (end < units && text[end] != 0) {
    end++;
  }
  CHAR16 *options = static_cast<CHAR16 *>(TrackedAllocatePool((end - start + 1) * sizeof(CHAR16)));
  if (options == nullptr) {
    Fatal("Could not get boot args\n");
  }
  for (UINTN i = start; i < end; i++) {
    options[i - start] = text[i];
  }
  options[end - start] = 0;
  return options;
}

int ChooseBootDirectory(const bool exists[3]) {
  if (exists[0] && exists[1] && exists[2]) {
    return 0;
  }
  // With two, the one that follows the other in the ring wins: for each
  // directory that exists, step to the next one in the ring while that exists.
  for (int i = 0; i < 3; i++) {
    if (exists[i] && !exists[(i + 2) % 3]) {
      return exists[(i + 1) % 3] ? (i + 1) % 3 : i;
    }
  }
  return -1;
}

static EFI_FILE *ChooseRootDirectory(EFI_FILE *volumeRoot) {
  EFI_FILE *file = nullptr;
  if (!EFI_ERROR(volumeRoot->Open(volumeRoot, &file, kDefaultKernelName, EFI_FILE_MODE_READ, 0))) {
    if (file != nullptr) {
      file->Close(file);
    }
    return volumeRoot;
  }

  // All three names are always tried.
  EFI_FILE *directories[3] = {nullptr, nullptr, nullptr};
  bool exists[3];
  CHAR16 name[1024];
  for (int i = 0; i < 3; i++) {
    SPrint(name, sizeof(name), u"%a", kBootDirectoryNames[i]);
    exists[i] = !EFI_ERROR(volumeRoot->Open(volumeRoot, &directories[i], name, EFI_FILE_MODE_READ, 0)) &&
                directories[i] != nullptr;
  }
  int chosen = ChooseBootDirectory(exists);
  if (chosen < 0) {
    return volumeRoot;
  }
  if (exists[0] && exists[1] && exists[2]) {
    printf("WARNING: all of R,P,S exist: booting from 'R'\n");
  }
  // The loser of a pair, or both losers of three, are closed; the winner and
  // the volume's root stay open for the rest of the run.
  for (int i = 0; i < 3; i++) {
    if (exists[i] && i != chosen) {
      directories[i]->Close(directories[i]);
    }
  }
  return directories[chosen];
}

BootVolume OpenBootVolume(EFI_HANDLE device) {
  BootVolume volume = {nullptr, nullptr};
  EFI_SIMPLE_FILE_SYSTEM_PROTOCOL *fileSystem = nullptr;
  if (EFI_ERROR(gBS->HandleProtocol(device, &gEfiSimpleFileSystemProtocolGuid,
                                    reinterpret_cast<void **>(&fileSystem))) ||
      fileSystem == nullptr) {
    // A network boot: nothing is probed.
    if (EFI_ERROR(gBS->HandleProtocol(device, &gEfiLoadFileProtocolGuid,
                                      reinterpret_cast<void **>(&volume.loadFile))) ||
        volume.loadFile == nullptr) {
      Fatal("Can't get a FileSystem or LoadFile handle for boot volume\n");
    }
    return volume;
  }
  EFI_FILE *volumeRoot = nullptr;
  if (EFI_ERROR(fileSystem->OpenVolume(fileSystem, &volumeRoot)) || volumeRoot == nullptr) {
    Fatal("Can't open booter's root volume\n");
  }
  volume.root = ChooseRootDirectory(volumeRoot);
  return volume;
}

}  // namespace nimb
