// The boot volume's identity as a UUID text for the kernel: the partition's
// GUID, or a name-based UUID from the identifier in the volume's header.
#pragma once

#include "efi/efi.h"

namespace nimb {

// 36 characters and a NUL.
constexpr UINTN kUuidTextSize = 37;

// Each writes the text into `text` of `size` bytes; EFI_BUFFER_TOO_SMALL,
// with nothing written, when it does not hold kUuidTextSize.
EFI_STATUS GetVolumeUuid(EFI_HANDLE handle, UINTN size, char *text);
EFI_STATUS GetVolumeUuidFromHeader(EFI_HANDLE handle, UINTN size, char *text);
EFI_STATUS UuidFromVolumeId(const UINT8 *id, UINTN idLength, UINTN size, char *text);
void FormatGuid(const EFI_GUID *guid, char *text);

}  // namespace nimb
