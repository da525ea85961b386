#include "devicetree/volume_uuid.h"

#include "boot/boot.h"
#include "memory/tracking.h"
#include "screen/console.h"
#include "support/checksum.h"
#include "support/devicepath.h"
#include "support/strings.h"

namespace nimb {

// The hard-drive device path node, by the offsets read here.
constexpr UINTN kHardDriveSignature = 24;
constexpr UINTN kHardDriveFormat = 40;
constexpr UINTN kHardDriveSignatureType = 41;
constexpr UINTN kHardDriveNodeSize = 42;
constexpr UINT8 kPartitionFormatGuidTable = 2;
constexpr UINT8 kSignatureTypeGuid = 2;

// The volume header at byte 1024 of a volume: big-endian numbers, as a
// wrapper around an embedded volume or as the volume's own header.
constexpr UINT64 kVolumeHeaderOffset = 1024;
constexpr UINTN kVolumeHeaderSize = 512;
constexpr UINTN kHeaderSignature = 0;
constexpr UINTN kWrapperBlockSize = 20;
constexpr UINTN kWrapperFirstSector = 28;
constexpr UINTN kVolumeIdentifier = 104;
constexpr UINTN kVolumeIdentifierSize = 8;
constexpr UINTN kEmbeddedSignature = 124;
constexpr UINTN kEmbeddedFirstBlock = 126;
constexpr UINT16 kWrapperSignature = 0x4244;
constexpr UINT16 kVolumeSignature = 0x482B;
constexpr UINT16 kVolumeSignatureAlternate = 0x4858;
constexpr UINT64 kSectorSize = 512;

// The name space of the volume UUIDs.
static const UINT8 kVolumeUuidNameSpace[16] = {0xB3, 0xE2, 0x0F, 0x39, 0xF2, 0x92, 0x11, 0xD6,
                                               0x97, 0xA4, 0x00, 0x30, 0x65, 0x43, 0xEC, 0xAC};

static UINT16 ReadBe16(const UINT8 *bytes) {
  return static_cast<UINT16>(bytes[0] << 8 | bytes[1]);
}

static UINT32 ReadBe32(const UINT8 *bytes) {
  return static_cast<UINT32>(ReadBe16(bytes)) << 16 | ReadBe16(bytes + 2);
}

// A hard-drive node of a partition of a GUID partition table, with a GUID as
// its signature. A node too short to hold the fields is none.
static bool IsGuidPartitionNode(const EFI_DEVICE_PATH_PROTOCOL *node) {
  const UINT8 *bytes = reinterpret_cast<const UINT8 *>(node);
  return DevicePathNodeType(node) == MEDIA_DEVICE_PATH && node->SubType == MEDIA_HARDDRIVE_DP &&
         DevicePathNodeLength(node) >= kHardDriveNodeSize &&
         bytes[kHardDriveFormat] == kPartitionFormatGuidTable &&
         bytes[kHardDriveSignatureType] == kSignatureTypeGuid;
}

EFI_STATUS GetVolumeUuid(EFI_HANDLE handle, UINTN size, char *text) {
  if (size < kUuidTextSize) {
    return EFI_BUFFER_TOO_SMALL;
  }
  UINTN remaining = kMaxDevicePathSize;
  const EFI_DEVICE_PATH_PROTOCOL *node = DevicePathFirstNode(DevicePathFromHandle(handle), &remaining);
  for (; node != nullptr && !IsDevicePathEnd(node); node = DevicePathNextNode(node, &remaining)) {
    if (IsGuidPartitionNode(node)) {
      EFI_GUID signature;
      memcpy(&signature, reinterpret_cast<const UINT8 *>(node) + kHardDriveSignature, sizeof(signature));
      FormatGuid(&signature, text);
      return EFI_SUCCESS;
    }
  }
  return GetVolumeUuidFromHeader(handle, size, text);
}

EFI_STATUS GetVolumeUuidFromHeader(EFI_HANDLE handle, UINTN size, char *text) {
  // Not given back on any path: it goes with the rest of the tracked memory.
  UINT8 *header = static_cast<UINT8 *>(TrackedAllocatePool(kVolumeHeaderSize));
  if (header == nullptr) {
    return EFI_OUT_OF_RESOURCES;
  }
  EFI_BLOCK_IO_PROTOCOL *blockIo = nullptr;
  EFI_STATUS status =
      gBS->HandleProtocol(handle, &gEfiBlockIoProtocolGuid, reinterpret_cast<void **>(&blockIo));
  if (EFI_ERROR(status)) {
    return status;
  }
  EFI_DISK_IO_PROTOCOL *diskIo = nullptr;
  status = gBS->HandleProtocol(handle, &gEfiDiskIoProtocolGuid, reinterpret_cast<void **>(&diskIo));
  if (EFI_ERROR(status)) {
    return status;
  }
  if (blockIo == nullptr || blockIo->Media == nullptr || diskIo == nullptr) {
    return EFI_UNSUPPORTED;
  }
  const UINT32 mediaId = blockIo->Media->MediaId;
  status = diskIo->ReadDisk(diskIo, mediaId, kVolumeHeaderOffset, kVolumeHeaderSize, header);
  if (EFI_ERROR(status)) {
    return status;
  }

  if (ReadBe16(header + kHeaderSignature) == kWrapperSignature) {
    if (ReadBe16(header + kEmbeddedSignature) != kVolumeSignature) {
      return EFI_UNSUPPORTED;
    }
    const UINT64 offset =
        ReadBe16(header + kWrapperFirstSector) * kSectorSize +
        static_cast<UINT64>(ReadBe32(header + kWrapperBlockSize)) * ReadBe16(header + kEmbeddedFirstBlock);
    // A wrapper whose embedded volume would start at 0 keeps its own
    // signature and is refused below.
    if (offset != 0) {
      status = diskIo->ReadDisk(diskIo, mediaId, offset + kVolumeHeaderOffset, kVolumeHeaderSize, header);
      if (EFI_ERROR(status)) {
        return status;
      }
    }
  }

  const UINT16 signature = ReadBe16(header + kHeaderSignature);
  if (signature != kVolumeSignature && signature != kVolumeSignatureAlternate) {
    return EFI_UNSUPPORTED;
  }
  return UuidFromVolumeId(header + kVolumeIdentifier, kVolumeIdentifierSize, size, text);
}

EFI_STATUS UuidFromVolumeId(const UINT8 *id, UINTN idLength, UINTN size, char *text) {
  if (size < kUuidTextSize) {
    return EFI_BUFFER_TOO_SMALL;
  }
  Md5Context context;
  Md5Init(&context);
  Md5Update(&context, kVolumeUuidNameSpace, sizeof(kVolumeUuidNameSpace));
  Md5Update(&context, id, static_cast<UINT32>(idLength));
  UINT8 digest[16];
  Md5Final(digest, &context);
  // A name-based UUID of version 3, of the variant of RFC 4122.
  digest[6] = static_cast<UINT8>((digest[6] & 0x0F) | 0x30);
  digest[8] = static_cast<UINT8>((digest[8] & 0x3F) | 0x80);

  static const char kHexDigits[] = "0123456789ABCDEF";
  char *out = text;
  for (UINTN i = 0; i < sizeof(digest); i++) {
    if (i == 4 || i == 6 || i == 8 || i == 10) {
      *out++ = '-';
    }
    *out++ = kHexDigits[digest[i] >> 4];
    *out++ = kHexDigits[digest[i] & 0x0F];
  }
  *out = '\0';
  return EFI_SUCCESS;
}

void FormatGuid(const EFI_GUID *guid, char *text) {
  sprintf(text, "%08X-%04X-%04X-%02X%02X-%02X%02X%02X%02X%02X%02X", static_cast<UINT64>(guid->Data1),
          static_cast<UINT64>(guid->Data2), static_cast<UINT64>(guid->Data3),
          static_cast<UINT64>(guid->Data4[0]), static_cast<UINT64>(guid->Data4[1]),
          static_cast<UINT64>(guid->Data4[2]), static_cast<UINT64>(guid->Data4[3]),
          static_cast<UINT64>(guid->Data4[4]), static_cast<UINT64>(guid->Data4[5]),
          static_cast<UINT64>(guid->Data4[6]), static_cast<UINT64>(guid->Data4[7]));
}

}  // namespace nimb
