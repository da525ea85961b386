#include "load/bootfile.h"

#include "memory/tracking.h"
#include "screen/console.h"
#include "support/devicepath.h"
#include "support/strings.h"

namespace nimb {

// The first try at a file's info record; most fit.
constexpr UINTN kFileInfoFirstTry = 208;

// A LoadFile record with nothing to fetch: its path could not be made.
static bool HasNoSource(const BootFile *file) {
  if (file->loadFile != nullptr) {
    return file->devicePath == nullptr;
  }
  return file->buffer == nullptr && file->fileHandle == nullptr;
}

// A bare file node for `name` with an end node behind it, relative to the
// LoadFile device itself.
static EFI_DEVICE_PATH_PROTOCOL *MakeFileNode(const CHAR16 *name) {
  UINT64 nameBytes = StrLen(name) * sizeof(CHAR16);
  UINT64 nodeLength = nameBytes + 2 + 4;
  if (nodeLength > 0xFFFF) {
    return nullptr;
  }
  UINT8 *path = static_cast<UINT8 *>(TrackedAllocatePool(nameBytes + 10));
  if (path == nullptr) {
    return nullptr;
  }
  bzero(path, nameBytes + 10);
  path[0] = MEDIA_DEVICE_PATH;
  path[1] = MEDIA_FILEPATH_DP;
  path[2] = static_cast<UINT8>(nodeLength & 0xFF);
  path[3] = static_cast<UINT8>(nodeLength >> 8);
  memcpy(path + 4, name, nameBytes + 2);
  path[nameBytes + 6] = END_DEVICE_PATH_TYPE;
  path[nameBytes + 7] = END_ENTIRE_DEVICE_PATH_SUBTYPE;
  path[nameBytes + 8] = 4;
  path[nameBytes + 9] = 0;
  return reinterpret_cast<EFI_DEVICE_PATH_PROTOCOL *>(path);
}

EFI_STATUS BootFileOpen(EFI_LOAD_FILE_INTERFACE *loadFile, EFI_FILE *root, const CHAR16 *name,
                        BootFile *file) {
  if (loadFile != nullptr) {
    bzero(file, sizeof(*file));
    file->loadFile = loadFile;
    if (name != nullptr) {
      file->devicePath = MakeFileNode(name);
      if (file->devicePath == nullptr) {
        return EFI_OUT_OF_RESOURCES;
      }
    }
    return EFI_SUCCESS;
  }
  if (root == nullptr || name == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  EFI_FILE *handle = nullptr;
  EFI_STATUS status = root->Open(root, &handle, name, EFI_FILE_MODE_READ, 0);
  if (EFI_ERROR(status)) {
    return status;
  }
  if (handle == nullptr) {
    return EFI_NOT_FOUND;
  }
  bzero(file, sizeof(*file));
  file->fileHandle = handle;
  return EFI_SUCCESS;
}

void BootFileOpenDevicePath(EFI_LOAD_FILE_INTERFACE *loadFile, const EFI_DEVICE_PATH_PROTOCOL *path,
                            BootFile *file) {
  bzero(file, sizeof(*file));
  file->loadFile = loadFile;
  EFI_DEVICE_PATH_PROTOCOL *copy = DuplicateDevicePath(path);
  if (copy != nullptr) {
    TrackPool(copy);
  }
  file->devicePath = copy;
}

void BootFileClose(BootFile *file) {
  file->size = 0;
  file->position = 0;
  if (file->devicePath != nullptr) {
    TrackedFree(file->devicePath);
    if (file->buffer != nullptr) {
      TrackedFree(file->buffer);
    }
  } else if (file->buffer == nullptr && file->fileHandle != nullptr) {
    file->fileHandle->Close(file->fileHandle);
  }
}

EFI_STATUS BootFileGetInfo(EFI_FILE *handle, EFI_FILE_INFO **info) {
  UINTN size = kFileInfoFirstTry;
  void *buffer = TrackedAllocatePool(size);
  if (buffer == nullptr) {
    return EFI_OUT_OF_RESOURCES;
  }
  EFI_STATUS status = handle->GetInfo(handle, &gEfiFileInfoGuid, &size, buffer);
  if (status == EFI_BUFFER_TOO_SMALL) {
    TrackedFree(buffer);
    buffer = TrackedAllocatePool(size);
    if (buffer == nullptr) {
      return EFI_OUT_OF_RESOURCES;
    }
    status = handle->GetInfo(handle, &gEfiFileInfoGuid, &size, buffer);
  }
  if (EFI_ERROR(status)) {
    TrackedFree(buffer);
    printf("Couldn't get file info.\n");
    return status;
  }
  *info = static_cast<EFI_FILE_INFO *>(buffer);
  return status;
}

EFI_STATUS BootFileGetSize(BootFile *file, UINT64 *size) {
  if (HasNoSource(file)) {
    return EFI_INVALID_PARAMETER;
  }
  if (file->loadFile != nullptr) {
    if (file->size == 0) {
      UINTN length = 0;
      EFI_STATUS status = file->loadFile->LoadFile(file->loadFile, file->devicePath, FALSE, &length, nullptr);
      if (status == EFI_SUCCESS) {
        // A device that answers the size query with success has told us
        // nothing: the file counts as empty.
        length = 0;
      } else if (status != EFI_BUFFER_TOO_SMALL) {
        return status;
      }
      file->size = length;
    }
  } else if (file->buffer == nullptr) {
    EFI_FILE_INFO *info = nullptr;
    EFI_STATUS status = BootFileGetInfo(file->fileHandle, &info);
    if (EFI_ERROR(status)) {
      return status;
    }
    UINT64 fileSize = info->FileSize;
    TrackedFree(info);
    if (size != nullptr) {
      *size = fileSize;
    }
    return EFI_SUCCESS;
  }
  if (size != nullptr) {
    *size = file->size;
  }
  return EFI_SUCCESS;
}

EFI_STATUS BootFileSetPosition(BootFile *file, UINT64 offset) {
  if (file->loadFile == nullptr && file->buffer == nullptr && file->fileHandle != nullptr) {
    return file->fileHandle->SetPosition(file->fileHandle, offset);
  }
  UINT64 size = 0;
  EFI_STATUS status = BootFileGetSize(file, &size);
  if (EFI_ERROR(status)) {
    return status;
  }
  if (offset > size) {
    return EFI_INVALID_PARAMETER;
  }
  file->position = offset;
  return EFI_SUCCESS;
}

// Copies from the record's buffer and advances its position.
static EFI_STATUS ReadFromBuffer(BootFile *file, UINT64 *count, void *destination) {
  UINT64 available = file->size - file->position;
  if (*count > available) {
    *count = available;
  }
  memcpy(destination, file->buffer + file->position, *count);
  file->position += *count;
  return EFI_SUCCESS;
}

static EFI_STATUS ReadFromVolume(BootFile *file, UINT64 *count, void *destination) {
  UINT8 *write = static_cast<UINT8 *>(destination);
  UINT64 remaining = *count;
  UINT64 total = 0;
  EFI_STATUS status = EFI_SUCCESS;
  while (remaining > 0) {
    UINTN chunk = remaining < kBootFileChunk ? remaining : kBootFileChunk;
    printf(".");
    status = file->fileHandle->Read(file->fileHandle, &chunk, write);
    if (chunk == 0) {
      break;
    }
    if (chunk > remaining) {
      // A firmware that claims more than it was asked for is not believed.
      chunk = remaining;
    }
    total += chunk;
    if (EFI_ERROR(status)) {
      printf("Read error 0x%x\n", status);
      break;
    }
    remaining -= chunk;
    write += chunk;
  }
  *count = total;
  return status;
}

static EFI_STATUS ReadFromLoadFile(BootFile *file, UINT64 *count, void *destination) {
  UINT64 size = 0;
  EFI_STATUS status = BootFileGetSize(file, &size);
  if (EFI_ERROR(status)) {
    return status;
  }
  if (file->buffer == nullptr && file->position == 0 && *count == size) {
    // The whole file in one read: straight into the caller's memory.
    UINTN length = *count;
    status = file->loadFile->LoadFile(file->loadFile, file->devicePath, FALSE, &length, destination);
    *count = length;
    return status;
  }
  if (file->buffer == nullptr && size - file->position != 0 && *count != 0) {
    // Fetched once, with a page of margin behind the file.
    UINT8 *buffer = static_cast<UINT8 *>(TrackedAllocatePool(size + EFI_PAGE_SIZE));
    if (buffer == nullptr) {
      return EFI_OUT_OF_RESOURCES;
    }
    UINTN length = size;
    status = file->loadFile->LoadFile(file->loadFile, file->devicePath, FALSE, &length, buffer);
    if (length != size) {
      Fatal("Network file size mismatch\n");
    }
    if (EFI_ERROR(status)) {
      TrackedFree(buffer);
      return status;
    }
    file->buffer = buffer;
  }
  if (file->buffer == nullptr) {
    *count = 0;
    return EFI_SUCCESS;
  }
  return ReadFromBuffer(file, count, destination);
}

EFI_STATUS BootFileRead(BootFile *file, UINT64 *count, void *destination) {
  if (HasNoSource(file)) {
    return EFI_INVALID_PARAMETER;
  }
  if (file->loadFile != nullptr) {
    return ReadFromLoadFile(file, count, destination);
  }
  if (file->buffer != nullptr) {
    return ReadFromBuffer(file, count, destination);
  }
  return ReadFromVolume(file, count, destination);
}

EFI_STATUS BootFileReadWhole(EFI_LOAD_FILE_INTERFACE *loadFile, EFI_FILE *root, const CHAR16 *name,
                             const EFI_DEVICE_PATH_PROTOCOL *path, UINT64 *size, UINT8 **buffer) {
  BootFile file;
  if (path != nullptr) {
    BootFileOpenDevicePath(loadFile, path, &file);
  } else {
    EFI_STATUS status = BootFileOpen(loadFile, root, name, &file);
    if (EFI_ERROR(status)) {
      return status;
    }
  }
  UINT64 fileSize = 0;
  EFI_STATUS status = BootFileGetSize(&file, &fileSize);
  if (EFI_ERROR(status)) {
    BootFileClose(&file);
    return status;
  }
  if (fileSize == 0) {
    BootFileClose(&file);
    *size = 0;
    *buffer = nullptr;
    return EFI_SUCCESS;
  }
  UINT8 *contents = static_cast<UINT8 *>(TrackedAllocatePool(fileSize));
  if (contents == nullptr) {
    BootFileClose(&file);
    return EFI_OUT_OF_RESOURCES;
  }
  UINT64 count = fileSize;
  status = BootFileRead(&file, &count, contents);
  BootFileClose(&file);
  if (EFI_ERROR(status)) {
    TrackedFree(contents);
    return status;
  }
  *size = count;
  *buffer = contents;
  return EFI_SUCCESS;
}

}  // namespace nimb
