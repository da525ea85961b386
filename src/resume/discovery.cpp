#include "resume/discovery.h"

#include "boot/boot.h"
#include "config/boot_options.h"
#include "devicetree/platform.h"
#include "efi/vendor.h"
#include "memory/tracking.h"
#include "support/devicepath.h"
#include "support/strings.h"
#include "support/text.h"

namespace nimb {

namespace {

// The fields of a hard-drive node that name a partition.
constexpr UINTN kHardDrivePartitionNumber = 4;
constexpr UINTN kHardDriveSignature = 24;
constexpr UINTN kHardDriveMbrType = 40;
constexpr UINTN kHardDriveSignatureType = 41;
constexpr UINTN kHardDriveNodeSize = 42;

UINT32 ReadU32(const UINT8 *bytes) {
  return static_cast<UINT32>(bytes[0]) | static_cast<UINT32>(bytes[1]) << 8 |
         static_cast<UINT32>(bytes[2]) << 16 | static_cast<UINT32>(bytes[3]) << 24;
}

// The first hard-drive node of a path of at most `bound` bytes, when it is
// long enough to hold the fields compared; null otherwise.
const UINT8 *FirstHardDriveNode(const EFI_DEVICE_PATH_PROTOCOL *path, UINTN bound) {
  const EFI_DEVICE_PATH_PROTOCOL *node =
      DevicePathFindNode(path, bound, MEDIA_DEVICE_PATH, MEDIA_HARDDRIVE_DP);
  if (node == nullptr || DevicePathNodeLength(node) < kHardDriveNodeSize) {
    return nullptr;
  }
  return reinterpret_cast<const UINT8 *>(node);
}

// Partition number, MBR type and signature type by value, the signature as
// a GUID. Where the partition starts and how long it is are not compared.
bool SamePartition(const UINT8 *a, const UINT8 *b) {
  if (ReadU32(a + kHardDrivePartitionNumber) != ReadU32(b + kHardDrivePartitionNumber) ||
      a[kHardDriveMbrType] != b[kHardDriveMbrType] ||
      a[kHardDriveSignatureType] != b[kHardDriveSignatureType]) {
    return false;
  }
  // Nodes are not aligned: the signatures are compared from aligned copies.
  EFI_GUID signatureA;
  EFI_GUID signatureB;
  memcpy(&signatureA, a + kHardDriveSignature, sizeof(EFI_GUID));
  memcpy(&signatureB, b + kHardDriveSignature, sizeof(EFI_GUID));
  return CompareGuid(&signatureA, &signatureB) != 0;
}

// The variable whole in tracked pool, its size in *size; null when it is
// missing, empty or unreadable, or no pool can be had.
UINT8 *ReadImageVariable(UINTN *size) {
  *size = 0;
  if (gRT->GetVariable(kResumeImageVariable, &gNimbVendorVariableGuid, nullptr, size, nullptr) !=
          EFI_BUFFER_TOO_SMALL ||
      *size == 0) {
    return nullptr;
  }
  UINT8 *data = static_cast<UINT8 *>(TrackedAllocatePool(*size));
  if (data == nullptr ||
      EFI_ERROR(gRT->GetVariable(kResumeImageVariable, &gNimbVendorVariableGuid, nullptr, size, data))) {
    return nullptr;
  }
  return data;
}

// The BlockIO handle whose device path's first hard-drive node names the
// same partition as `wanted`; the first one in the firmware's order.
EFI_HANDLE FindPartition(const UINT8 *wanted) {
  UINTN count = 0;
  EFI_HANDLE *handles = nullptr;
  EFI_STATUS status =
      gBS->LocateHandleBuffer(ByProtocol, &gEfiBlockIoProtocolGuid, nullptr, &count, &handles);
  if (EFI_ERROR(status) || handles == nullptr) {
    return nullptr;
  }
  TrackPool(handles);
  EFI_HANDLE found = nullptr;
  for (UINTN i = 0; i < count && found == nullptr; i++) {
    const UINT8 *node = FirstHardDriveNode(DevicePathFromHandle(handles[i]), kMaxDevicePathSize);
    if (node != nullptr && SamePartition(node, wanted)) {
      found = handles[i];
    }
  }
  TrackedFree(handles);
  return found;
}

// The image's byte offset on the partition: the hexadecimal text of the
// first file-path node, with or without "0x". The text ends at its first
// zero unit or at the node's end, whichever comes first. False when there is
// no such node or no pool for the conversion.
bool ReadImageOffset(const EFI_DEVICE_PATH_PROTOCOL *path, UINTN size, UINT64 *offset) {
  const EFI_DEVICE_PATH_PROTOCOL *node = DevicePathFindNode(path, size, MEDIA_DEVICE_PATH, MEDIA_FILEPATH_DP);
  if (node == nullptr) {
    return false;
  }
  // An aligned, terminated copy of the name, which in the node may be neither.
  const UINTN nameBytes = (DevicePathNodeLength(node) - kDevicePathNodeHeadSize) & ~static_cast<UINTN>(1);
  CHAR16 *name = static_cast<CHAR16 *>(TrackedAllocatePool(nameBytes + sizeof(CHAR16)));
  if (name == nullptr) {
    return false;
  }
  memcpy(name, reinterpret_cast<const UINT8 *>(node) + kDevicePathNodeHeadSize, nameBytes);
  name[nameBytes / sizeof(CHAR16)] = 0;
  char *text = UcsToUtf8Alloc(name);
  TrackedFree(name);
  if (text == nullptr) {
    return false;
  }
  *offset = strtoul(text, nullptr, 16);
  TrackedFree(text);
  return true;
}

// Reads and deletes the key. A missing key is no failure here: the buffer
// stays null and only an encrypted image will need it.
void TakeKey(ResumeState *state) {
  UINTN size = 0;
  if (gRT->GetVariable(kResumeKeyVariable, &gNimbVendorVariableGuid, nullptr, &size, nullptr) !=
          EFI_BUFFER_TOO_SMALL ||
      size == 0) {
    state->keyLength = size;
    return;
  }
  const UINTN bufferSize = size;
  state->key = static_cast<UINT8 *>(TrackedAllocatePool(bufferSize));
  if (state->key != nullptr) {
    state->keyBufferSize = bufferSize;
    // The read's status is not looked at; the size it leaves is the key's
    // length, never more than the buffer.
    gRT->GetVariable(kResumeKeyVariable, &gNimbVendorVariableGuid, nullptr, &size, state->key);
    if (size > bufferSize) {
      size = bufferSize;
    }
  }
  state->keyLength = size;
  gRT->SetVariable(kResumeKeyVariable, &gNimbVendorVariableGuid, 0, 0, nullptr);
}

// The header belongs to this machine unless the FACS's hardware signature
// says otherwise; without ACPI tables, a FACP or a FACS there is no check.
bool SameMachine(const ResumeHeader *header) {
  const UINT8 *facs = FindFacs();
  return facs == nullptr || static_cast<UINT64>(FacsHardwareSignature(facs)) == header->machineSignature;
}

}  // namespace

BOOLEAN ResumeRequested() {
  // A safe-mode boot restarts no image. Nothing has set the flags when the
  // boot driver calls this, so the test only counts for a caller that has.
  if ((gBootFlags & kBootSafeMode) != 0) {
    return FALSE;
  }
  UINTN size = 0;
  if (gRT->GetVariable(kResumeSignatureVariable, &gNimbVendorVariableGuid, nullptr, &size, nullptr) !=
      EFI_BUFFER_TOO_SMALL) {
    return FALSE;
  }
  gRT->SetVariable(kResumeSignatureVariable, &gNimbVendorVariableGuid, 0, 0, nullptr);
  return TRUE;
}

BOOLEAN ResumeFindImage(ResumeState *state) {
  // The variable's buffer stays allocated; it is never freed on this path.
  UINTN pathSize = 0;
  const UINT8 *pathBytes = ReadImageVariable(&pathSize);
  if (pathBytes == nullptr) {
    return FALSE;
  }
  const EFI_DEVICE_PATH_PROTOCOL *path = reinterpret_cast<const EFI_DEVICE_PATH_PROTOCOL *>(pathBytes);
  const UINT8 *wanted = FirstHardDriveNode(path, pathSize);
  if (wanted == nullptr) {
    return FALSE;
  }
  EFI_HANDLE partition = FindPartition(wanted);
  if (partition == nullptr) {
    return FALSE;
  }
  EFI_BLOCK_IO_PROTOCOL *blockIo = nullptr;
  if (EFI_ERROR(gBS->HandleProtocol(partition, &gEfiDiskIoProtocolGuid,
                                    reinterpret_cast<void **>(&state->diskIo))) ||
      EFI_ERROR(
          gBS->HandleProtocol(partition, &gEfiBlockIoProtocolGuid, reinterpret_cast<void **>(&blockIo))) ||
      state->diskIo == nullptr || blockIo == nullptr || blockIo->Media == nullptr) {
    return FALSE;
  }
  state->mediaId = blockIo->Media->MediaId;

  UINT64 offset = 0;
  if (!ReadImageOffset(path, pathSize, &offset)) {
    return FALSE;
  }

  // The key leaves NVRAM before the disk is read: no failure from here on
  // leaves it behind.
  TakeKey(state);

  state->poolHeader = static_cast<ResumeHeader *>(TrackedAllocatePool(sizeof(ResumeHeader)));
  if (state->poolHeader == nullptr) {
    return FALSE;
  }
  bzero(state->poolHeader, sizeof(ResumeHeader));
  if (EFI_ERROR(state->diskIo->ReadDisk(state->diskIo, state->mediaId, offset, sizeof(ResumeHeader),
                                        state->poolHeader))) {
    return FALSE;
  }
  return state->poolHeader->magic == kResumeMagic && SameMachine(state->poolHeader);
}

}  // namespace nimb
