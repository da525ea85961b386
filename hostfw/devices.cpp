// Block devices: BlockIO and DiskIO over a disk image in memory, the whole
// disk or a partition of it.
#include <algorithm>
#include <cstring>

#include "hostfw/internal.h"

namespace hostfw {

namespace {

constexpr UINT64 kBlockIoRevision = 0x00010000;
constexpr UINT64 kDiskIoRevision = 0x00010000;

BlockDevice *FindBlockIo(State &s, EFI_BLOCK_IO_PROTOCOL *This) {
  for (const auto &device : s.blockDevices) {
    if (&device->blockIo == This)
      return device.get();
  }
  return nullptr;
}

BlockDevice *FindDiskIo(State &s, EFI_DISK_IO_PROTOCOL *This) {
  for (const auto &device : s.blockDevices) {
    if (&device->diskIo == This)
      return device.get();
  }
  return nullptr;
}

// Copies `size` bytes at `offset` of the device's view, which the caller has
// checked against the view's bounds.
void CopyOut(const BlockDevice &device, UINT64 offset, UINTN size, VOID *buffer) {
  std::memcpy(buffer, device.image->data() + device.offset + offset, size);
}

EFI_STATUS EFIAPI BlockReset(EFI_BLOCK_IO_PROTOCOL *This, BOOLEAN) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "BlockReset", &failure))
    return failure;
  return FindBlockIo(s, This) != nullptr ? EFI_SUCCESS : EFI_INVALID_PARAMETER;
}

EFI_STATUS EFIAPI ReadBlocks(EFI_BLOCK_IO_PROTOCOL *This, UINT32 MediaId, UINT64 Lba, UINTN BufferSize,
                             VOID *Buffer) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "ReadBlocks", &failure))
    return failure;
  BlockDevice *device = FindBlockIo(s, This);
  if (device == nullptr)
    return EFI_INVALID_PARAMETER;
  if (MediaId != device->media.MediaId)
    return EFI_MEDIA_CHANGED;
  if (Buffer == nullptr)
    return EFI_INVALID_PARAMETER;
  if (BufferSize == 0)
    return EFI_SUCCESS;
  const UINT64 blockSize = device->media.BlockSize;
  if (BufferSize % blockSize != 0)
    return EFI_BAD_BUFFER_SIZE;
  if (Lba > device->media.LastBlock || BufferSize / blockSize > device->media.LastBlock - Lba + 1) {
    return EFI_INVALID_PARAMETER;
  }
  CopyOut(*device, Lba * blockSize, BufferSize, Buffer);
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI WriteBlocks(EFI_BLOCK_IO_PROTOCOL *This, UINT32, UINT64, UINTN, VOID *) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "WriteBlocks", &failure))
    return failure;
  return FindBlockIo(s, This) != nullptr ? EFI_WRITE_PROTECTED : EFI_INVALID_PARAMETER;
}

EFI_STATUS EFIAPI FlushBlocks(EFI_BLOCK_IO_PROTOCOL *This) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "FlushBlocks", &failure))
    return failure;
  return FindBlockIo(s, This) != nullptr ? EFI_SUCCESS : EFI_INVALID_PARAMETER;
}

EFI_STATUS EFIAPI ReadDisk(EFI_DISK_IO_PROTOCOL *This, UINT32 MediaId, UINT64 Offset, UINTN BufferSize,
                           VOID *Buffer) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "ReadDisk", &failure))
    return failure;
  BlockDevice *device = FindDiskIo(s, This);
  if (device == nullptr)
    return EFI_INVALID_PARAMETER;
  if (MediaId != device->media.MediaId)
    return EFI_MEDIA_CHANGED;
  if (Offset > device->size || BufferSize > device->size - Offset)
    return EFI_INVALID_PARAMETER;
  if (BufferSize == 0)
    return EFI_SUCCESS;
  if (Buffer == nullptr)
    return EFI_INVALID_PARAMETER;
  CopyOut(*device, Offset, BufferSize, Buffer);
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI WriteDisk(EFI_DISK_IO_PROTOCOL *This, UINT32, UINT64, UINTN, VOID *) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "WriteDisk", &failure))
    return failure;
  return FindDiskIo(s, This) != nullptr ? EFI_WRITE_PROTECTED : EFI_INVALID_PARAMETER;
}

}  // namespace

// --- The test's view --------------------------------------------------------------

EFI_HANDLE Firmware::AddBlockDevice(std::shared_ptr<std::vector<uint8_t>> image, UINT32 blockSize,
                                    UINT64 partitionStart, UINT64 partitionBlocks) {
  State &s = *s_;
  if (image == nullptr || blockSize == 0 || (blockSize & (blockSize - 1)) != 0) {
    Misuse("AddBlockDevice needs an image and a block size that is a power of two");
  }
  const UINT64 imageBlocks = image->size() / blockSize;
  const bool partition = partitionStart != 0 || partitionBlocks != 0;
  if (partitionBlocks == 0)
    partitionBlocks = imageBlocks > partitionStart ? imageBlocks - partitionStart : 0;
  if (partitionBlocks == 0 || partitionStart > imageBlocks ||
      partitionBlocks > imageBlocks - partitionStart) {
    Misuse("AddBlockDevice: the view does not fit the image's %llu blocks", (unsigned long long)imageBlocks);
  }

  auto device = std::make_unique<BlockDevice>();
  device->image = image;
  device->offset = partitionStart * blockSize;
  device->size = partitionBlocks * blockSize;
  device->media = {};
  device->media.MediaId = UINT32(s.blockDevices.size() + 1);
  device->media.MediaPresent = TRUE;
  device->media.LogicalPartition = partition;
  device->media.ReadOnly = TRUE;
  device->media.BlockSize = blockSize;
  device->media.LastBlock = partitionBlocks - 1;
  device->blockIo = {};
  device->blockIo.Revision = kBlockIoRevision;
  device->blockIo.Media = &device->media;
  device->blockIo.Reset = BlockReset;
  device->blockIo.ReadBlocks = ReadBlocks;
  device->blockIo.WriteBlocks = reinterpret_cast<void *>(WriteBlocks);
  device->blockIo.FlushBlocks = reinterpret_cast<void *>(FlushBlocks);
  device->diskIo = {kDiskIoRevision, ReadDisk, reinterpret_cast<void *>(WriteDisk)};

  // The disk and its partitions share the disk's hardware path; partitions
  // are numbered on each disk in the order they are added.
  auto disk = s.disks.find(image.get());
  if (disk == s.disks.end())
    disk = s.disks.insert({image.get(), {s.nextPciDevice++, 0}}).first;
  std::vector<uint8_t> path;
  AppendHardwareNodes(path, disk->second.first);
  if (partition) {
    UINT32 number = ++disk->second.second;
    AppendHardDriveNode(path, number, partitionStart, partitionBlocks,
                        PartitionSignature(disk->second.first, number));
  }
  AppendEndNode(path);

  EFI_HANDLE handle = AddHandle(s);
  InstallDevicePath(s, handle, std::move(path));
  PutInterface(s, handle, gEfiBlockIoProtocolGuid, &device->blockIo);
  PutInterface(s, handle, gEfiDiskIoProtocolGuid, &device->diskIo);
  s.blockDevices.push_back(std::move(device));
  return handle;
}

}  // namespace hostfw
