// The network's file loader: a LoadFile protocol that fetches any file by
// name from the TFTP server that the machine was booted from, through the
// firmware's PXE base code. The firmware's own PXE LoadFile serves only its
// one boot file; the loader asks a network device for its kernel, its driver
// package and its configuration file by name.
#pragma once

#include "efi/efi.h"
#include "efi/pxe.h"

namespace nimb::platform {

// The longest file name that goes into a TFTP read request, in bytes. The
// request (opcode, name, mode and the size and block size options) must fit
// in one 512-byte packet; a longer name is refused before anything is sent.
constexpr UINTN kMaxTftpNameLength = 400;

// The block size asked of the server: the largest whose packets fit in one
// Ethernet frame without fragments (1500 - 20 IP - 8 UDP - 4 TFTP). A server
// that accepts less answers with its own, and the base code takes that.
constexpr UINTN kTftpBlockSize = 1468;

struct PlatformNetLoadFile {
  // First, so that the protocol's `This` is the whole record.
  EFI_LOAD_FILE_PROTOCOL protocol;
  EFI_PXE_BASE_CODE_PROTOCOL *pxe;
  EFI_IP_ADDRESS server;
  UINTN blockSize;
  // Hears of every transfer: the TFTP name, "size" or "read", the room the
  // caller gave (reads only), the status and the size that came back; null
  // for none.
  void (*onTransfer)(const char *name, const char *what, UINT64 room, EFI_STATUS status, UINT64 size);
  // Hears of a read as it starts, with the room the caller gave; null for
  // none.
  void (*onReadStart)(const char *name, UINT64 room);
};

// Fills in the protocol over the base code and the server's address.
//
// LoadFile(This, FilePath, BootPolicy, BufferSize, Buffer): the file's name
// is the text of the path's file path nodes, joined by `/`, with `\` read as
// `/` and leading separators dropped; nodes of other kinds (the device's own
// path in front) are passed over, and BootPolicy doesn't matter. A null
// buffer or a size of 0 asks for the size: EFI_BUFFER_TOO_SMALL with the
// file's size (EFI_SUCCESS and 0 for an empty file). Otherwise the whole
// file comes in one transfer into the buffer and `*BufferSize` gets the
// number of bytes that came; a file larger than the buffer answers
// EFI_BUFFER_TOO_SMALL with its size. A file the server doesn't have is
// EFI_NOT_FOUND; a path without a name, a name longer than
// kMaxTftpNameLength or with characters outside printable ASCII is
// EFI_INVALID_PARAMETER, and nothing goes on the wire. Any other failure of
// the transfer (a server that stops answering: EFI_TIMEOUT) is passed on.
void NetLoadFileInit(PlatformNetLoadFile *loader, EFI_PXE_BASE_CODE_PROTOCOL *pxe,
                     const EFI_IP_ADDRESS &server);

// The TFTP name of a device path as LoadFile reads it into `name` of
// `capacity` bytes (kMaxTftpNameLength + 1 suffice); an error status as
// above.
EFI_STATUS NetLoadFileName(const EFI_DEVICE_PATH_PROTOCOL *path, char *name, UINTN capacity);

// A whole file by its TFTP name, as LoadFile fetches it: a size query, then
// one transfer into a buffer from `allocate`, whose size is returned in
// `*size`. The buffer is the caller's, also on a failure after it was given.
// A name as LoadFile would refuse it is EFI_INVALID_PARAMETER; a file that
// comes with another size than listed is EFI_END_OF_FILE.
EFI_STATUS NetLoadFileFetch(PlatformNetLoadFile *loader, const char *name, void *(*allocate)(UINTN size),
                            void **buffer, UINT64 *size);

}  // namespace nimb::platform
