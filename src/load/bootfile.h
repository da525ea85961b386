// One record for every file the loader reads: a file of a volume, a file
// that only a LoadFile device can fetch (a network boot), or a block of
// memory that already holds a file's contents.
#pragma once

#include "efi/efi.h"

namespace nimb {

struct BootFile {
  EFI_LOAD_FILE_INTERFACE *loadFile;     // LoadFile kind
  EFI_FILE *fileHandle;                  // volume file kind
  EFI_DEVICE_PATH_PROTOCOL *devicePath;  // LoadFile kind's path, owned, tracked
  UINT8 *buffer;                         // whole contents: fetched (LoadFile) or given (memory)
  UINT64 position;                       // LoadFile and memory kinds
  UINT64 size;                           // LoadFile and memory kinds; 0 in LoadFile: not asked yet
};
static_assert(sizeof(BootFile) == 48, "six 64-bit fields");

// Reads of volume files go to the firmware in chunks of this size, with a
// dot on the console for each.
constexpr UINT64 kBootFileChunk = 0x10000;

EFI_STATUS BootFileOpen(EFI_LOAD_FILE_INTERFACE *loadFile, EFI_FILE *root, const CHAR16 *name,
                        BootFile *file);
void BootFileOpenDevicePath(EFI_LOAD_FILE_INTERFACE *loadFile, const EFI_DEVICE_PATH_PROTOCOL *path,
                            BootFile *file);
void BootFileClose(BootFile *file);
EFI_STATUS BootFileGetInfo(EFI_FILE *handle, EFI_FILE_INFO **info);
EFI_STATUS BootFileGetSize(BootFile *file, UINT64 *size);
EFI_STATUS BootFileSetPosition(BootFile *file, UINT64 offset);
EFI_STATUS BootFileRead(BootFile *file, UINT64 *count, void *destination);
EFI_STATUS BootFileReadWhole(EFI_LOAD_FILE_INTERFACE *loadFile, EFI_FILE *root, const CHAR16 *name,
                             const EFI_DEVICE_PATH_PROTOCOL *path, UINT64 *size, UINT8 **buffer);

}  // namespace nimb
