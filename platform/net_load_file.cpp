#include "net_load_file.h"

namespace nimb::platform {

namespace {

UINTN NodeLength(const EFI_DEVICE_PATH_PROTOCOL *node) {
  return static_cast<UINTN>(node->Length[0]) | (static_cast<UINTN>(node->Length[1]) << 8);
}

bool IsSeparator(char c) {
  return c == '/' || c == '\\';
}

// A failed transfer as the caller should see it: a server that answers the
// request with an error packet (its "file not found", or a refusal) doesn't
// have the file to give.
EFI_STATUS TransferStatus(EFI_STATUS status) {
  return status == EFI_TFTP_ERROR ? EFI_NOT_FOUND : status;
}

EFI_STATUS QuerySize(PlatformNetLoadFile *loader, const char *name, UINT64 *size) {
  *size = 0;
  UINTN blockSize = loader->blockSize;
  const EFI_STATUS status = TransferStatus(loader->pxe->Mtftp(
      loader->pxe, EFI_PXE_BASE_CODE_TFTP_GET_FILE_SIZE, nullptr, FALSE, size, &blockSize, &loader->server,
      reinterpret_cast<UINT8 *>(const_cast<char *>(name)), nullptr, FALSE));
  if (loader->onTransfer != nullptr) {
    loader->onTransfer(name, "size", 0, status, *size);
  }
  return status;
}

// LoadFile's work for a name: `*bufferSize` in and out as LoadFile has it.
EFI_STATUS Transfer(PlatformNetLoadFile *loader, const char *name, UINTN *bufferSize, void *buffer) {
  UINT64 size = 0;
  if (buffer == nullptr || *bufferSize == 0) {
    const EFI_STATUS status = QuerySize(loader, name, &size);
    if (EFI_ERROR(status)) {
      return status;
    }
    *bufferSize = size;
    return size == 0 ? EFI_SUCCESS : EFI_BUFFER_TOO_SMALL;
  }
  const UINT64 room = *bufferSize;
  size = room;
  if (loader->onReadStart != nullptr) {
    loader->onReadStart(name, room);
  }
  UINTN blockSize = loader->blockSize;
  EFI_STATUS status = TransferStatus(loader->pxe->Mtftp(
      loader->pxe, EFI_PXE_BASE_CODE_TFTP_READ_FILE, buffer, FALSE, &size, &blockSize, &loader->server,
      reinterpret_cast<UINT8 *>(const_cast<char *>(name)), nullptr, FALSE));
  if (loader->onTransfer != nullptr) {
    loader->onTransfer(name, "read", room, status, size);
  }
  if (status == EFI_BUFFER_TOO_SMALL) {
    // The file outgrew the buffer: the caller learns its size now.
    status = QuerySize(loader, name, &size);
    if (EFI_ERROR(status)) {
      return status;
    }
    *bufferSize = size;
    return size > room ? EFI_BUFFER_TOO_SMALL : EFI_DEVICE_ERROR;
  }
  if (EFI_ERROR(status)) {
    return status;
  }
  if (size > room) {
    return EFI_DEVICE_ERROR;  // the base code wrote past what it was given
  }
  *bufferSize = size;
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI NetLoadFile(EFI_LOAD_FILE_PROTOCOL *This, EFI_DEVICE_PATH_PROTOCOL *FilePath, BOOLEAN,
                              UINTN *BufferSize, VOID *Buffer) {
  if (This == nullptr || FilePath == nullptr || BufferSize == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  char name[kMaxTftpNameLength + 1];
  PlatformNetLoadFile *loader = reinterpret_cast<PlatformNetLoadFile *>(This);
  const EFI_STATUS status = NetLoadFileName(FilePath, name, sizeof(name));
  if (EFI_ERROR(status)) {
    if (loader->onTransfer != nullptr) {
      loader->onTransfer("a path of no TFTP name", "request", 0, status, 0);
    }
    return status;
  }
  return Transfer(loader, name, BufferSize, Buffer);
}

}  // namespace

EFI_STATUS NetLoadFileName(const EFI_DEVICE_PATH_PROTOCOL *path, char *name, UINTN capacity) {
  UINTN length = 0;
  const UINT8 *bytes = reinterpret_cast<const UINT8 *>(path);
  for (;;) {
    const EFI_DEVICE_PATH_PROTOCOL *node = reinterpret_cast<const EFI_DEVICE_PATH_PROTOCOL *>(bytes);
    const UINTN nodeLength = NodeLength(node);
    if ((node->Type & 0x7F) == END_DEVICE_PATH_TYPE && node->SubType == END_ENTIRE_DEVICE_PATH_SUBTYPE) {
      break;
    }
    if (nodeLength < sizeof(EFI_DEVICE_PATH_PROTOCOL)) {
      return EFI_INVALID_PARAMETER;
    }
    if (node->Type == MEDIA_DEVICE_PATH && node->SubType == MEDIA_FILEPATH_DP) {
      // Units of the node's text up to its NUL or its end; a node's text is
      // not aligned, so it is read a byte at a time.
      const UINT8 *text = bytes + sizeof(EFI_DEVICE_PATH_PROTOCOL);
      const UINTN units = (nodeLength - sizeof(EFI_DEVICE_PATH_PROTOCOL)) / sizeof(CHAR16);
      if (length != 0 && !IsSeparator(name[length - 1])) {
        if (length + 1 >= capacity || length + 1 > kMaxTftpNameLength) {
          return EFI_INVALID_PARAMETER;
        }
        name[length++] = '/';
      }
      for (UINTN i = 0; i < units; i++) {
        const UINT16 unit = static_cast<UINT16>(text[2 * i] | (text[2 * i + 1] << 8));
        if (unit == 0) {
          break;
        }
        if (unit < 0x20 || unit > 0x7E) {
          return EFI_INVALID_PARAMETER;
        }
        const char c = unit == '\\' ? '/' : static_cast<char>(unit);
        if (length == 0 && IsSeparator(c)) {
          continue;
        }
        if (length + 1 >= capacity || length + 1 > kMaxTftpNameLength) {
          return EFI_INVALID_PARAMETER;
        }
        name[length++] = c;
      }
    }
    bytes += nodeLength;
  }
  if (length == 0 || capacity == 0) {
    return EFI_INVALID_PARAMETER;
  }
  name[length] = 0;
  return EFI_SUCCESS;
}

void NetLoadFileInit(PlatformNetLoadFile *loader, EFI_PXE_BASE_CODE_PROTOCOL *pxe,
                     const EFI_IP_ADDRESS &server) {
  loader->protocol.LoadFile = NetLoadFile;
  loader->pxe = pxe;
  loader->server = server;
  loader->blockSize = kTftpBlockSize;
  loader->onTransfer = nullptr;
  loader->onReadStart = nullptr;
}

EFI_STATUS NetLoadFileFetch(PlatformNetLoadFile *loader, const char *name, void *(*allocate)(UINTN size),
                            void **buffer, UINT64 *size) {
  *buffer = nullptr;
  *size = 0;
  UINTN length = 0;
  while (name[length] != 0 && length <= kMaxTftpNameLength) {
    length++;
  }
  if (length == 0 || length > kMaxTftpNameLength) {
    return EFI_INVALID_PARAMETER;
  }
  UINTN bufferSize = 0;
  EFI_STATUS status = Transfer(loader, name, &bufferSize, nullptr);
  if (status != EFI_BUFFER_TOO_SMALL) {
    return EFI_ERROR(status) ? status : EFI_SUCCESS;
  }
  *buffer = allocate(bufferSize);
  if (*buffer == nullptr) {
    return EFI_OUT_OF_RESOURCES;
  }
  const UINTN listed = bufferSize;
  status = Transfer(loader, name, &bufferSize, *buffer);
  *size = bufferSize;
  if (!EFI_ERROR(status) && bufferSize != listed) {
    return EFI_END_OF_FILE;  // delivered another size than listed
  }
  return status;
}

}  // namespace nimb::platform
