#include "resume_watch.h"

#include "efi/vendor.h"
#include "firmware.h"
#include "format.h"
#include "serial.h"
#include "tsc.h"

namespace nimb::platform {

namespace {

// The platform's own variable: the number of starts of this run, there only
// from a reset that went through the platform's ResetSystem to the next
// start, which deletes it: nothing of it stays once a run has ended.
constexpr EFI_GUID kPlatformVariableGuid = {
    0x5C1A7E02, 0x93D4, 0x4B6F, {0x8E, 0x21, 0x4A, 0x07, 0xC3, 0x9B, 0xD5, 0x60}};
constexpr const CHAR16 *kBootCountName = u"platform-boots";

constexpr const CHAR16 *kResumeVariables[] = {u"boot-signature", u"boot-image", u"boot-image-key"};
constexpr const char *kResumeVariableNames[] = {"boot-signature", "boot-image", "boot-image-key"};

typedef EFI_STATUS(EFIAPI *ReadDiskFunction)(EFI_DISK_IO_PROTOCOL *This, UINT32 MediaId, UINT64 Offset,
                                             UINTN BufferSize, VOID *Buffer);
typedef VOID(EFIAPI *ResetSystemFunction)(EFI_RESET_TYPE ResetType, EFI_STATUS ResetStatus, UINTN DataSize,
                                          const VOID *ResetData);
typedef EFI_STATUS(EFIAPI *GetMemoryMapFunction)(UINTN *MemoryMapSize, EFI_MEMORY_DESCRIPTOR *MemoryMap,
                                                 UINTN *MapKey, UINTN *DescriptorSize,
                                                 UINT32 *DescriptorVersion);
typedef EFI_STATUS(EFIAPI *CalculateCrc32Function)(const VOID *Data, UINTN DataSize, UINT32 *Crc32);

constexpr UINT32 kMaxDiskInterfaces = 32;
constexpr UINT32 kMaxLoggedReads = 48;

struct WatchedDisk {
  EFI_DISK_IO_PROTOCOL *interface;
  ReadDiskFunction original;
  UINT32 partition;  // 0 for a whole disk
};

struct LoggedRead {
  UINT32 partition;
  UINT64 offset;
  UINT64 size;
  UINT64 destination;
  EFI_STATUS status;
};

WatchedDisk gDisks[kMaxDiskInterfaces];
UINT32 gDiskCount;
LoggedRead gReads[kMaxLoggedReads];
UINT64 gReadCount;
UINT64 gReadBytes;
UINT32 gReadDepth;
bool gTimeReads;
ResetSystemFunction gOriginalReset;
UINT32 gBootCount;
// Boot services have ended: a reset now is the kernel's, not the loader's.
bool gBootServicesEnded;
EFI_EVENT gBootServicesEndEvent;
GetMemoryMapFunction gOriginalGetMemoryMap;

EFI_STATUS EFIAPI WatchedReadDisk(EFI_DISK_IO_PROTOCOL *This, UINT32 MediaId, UINT64 Offset, UINTN BufferSize,
                                  VOID *Buffer) {
  ReadDiskFunction original = nullptr;
  UINT32 partition = 0;
  for (UINT32 i = 0; i < gDiskCount; i++) {
    if (gDisks[i].interface == This) {
      original = gDisks[i].original;
      partition = gDisks[i].partition;
    }
  }
  if (original == nullptr) {
    return EFI_DEVICE_ERROR;
  }
  // A partition's DiskIO reads through its disk's: only the outer call is
  // the caller's.
  const UINT64 begin = ReadTsc();
  gReadDepth++;
  const EFI_STATUS status = original(This, MediaId, Offset, BufferSize, Buffer);
  if (--gReadDepth != 0) {
    return status;
  }
  if (gTimeReads) {
    const UINT64 end = ReadTsc();
    ReportTsc("read-begin", begin);
    ReportTsc("read-end", end);
  }
  if (gReadCount < kMaxLoggedReads) {
    gReads[gReadCount] = {partition, Offset, BufferSize, reinterpret_cast<UINT64>(Buffer), status};
  }
  gReadCount++;
  gReadBytes += BufferSize;
  return status;
}

// With the reads timed: the counter at each GetMemoryMap call, the last of
// which, before a restart, comes right after the decryption.
EFI_STATUS EFIAPI TimedGetMemoryMap(UINTN *MemoryMapSize, EFI_MEMORY_DESCRIPTOR *MemoryMap, UINTN *MapKey,
                                    UINTN *DescriptorSize, UINT32 *DescriptorVersion) {
  ReportTsc("memory-map", ReadTsc());
  return gOriginalGetMemoryMap(MemoryMapSize, MemoryMap, MapKey, DescriptorSize, DescriptorVersion);
}

// Only port output here: the call may come after ExitBootServices.
VOID EFIAPI WatchedResetSystem(EFI_RESET_TYPE ResetType, EFI_STATUS ResetStatus, UINTN DataSize,
                               const VOID *ResetData) {
  SerialPrintf("\nplatform: reset type %u status 0x%x\n", static_cast<UINT64>(ResetType), ResetStatus);
  for (UINT64 i = 0; i < gReadCount && i < kMaxLoggedReads; i++) {
    SerialPrintf("platform: read partition=%u offset=0x%x size=0x%x to=0x%x status=0x%x\n",
                 static_cast<UINT64>(gReads[i].partition), gReads[i].offset, gReads[i].size,
                 gReads[i].destination, gReads[i].status);
  }
  SerialPrintf("platform: reads %u, bytes 0x%x\n", gReadCount, gReadBytes);
  // The count of starts is kept over a reset of the loader's, and only
  // over it.
  if (!gBootServicesEnded) {
    EFI_GUID guid = kPlatformVariableGuid;
    gRT->SetVariable(kBootCountName, &guid, EFI_VARIABLE_NON_VOLATILE | EFI_VARIABLE_BOOTSERVICE_ACCESS,
                     sizeof(gBootCount), &gBootCount);
  }
  gOriginalReset(ResetType, ResetStatus, DataSize, ResetData);
}

VOID EFIAPI NoteBootServicesEnd(EFI_EVENT, VOID *) {
  gBootServicesEnded = true;
}

UINTN NodeLength(const EFI_DEVICE_PATH_PROTOCOL *node) {
  return static_cast<UINTN>(node->Length[0]) | (static_cast<UINTN>(node->Length[1]) << 8);
}

// The partition number of the first hard-drive node of `handle`'s path; 0
// for none.
UINT32 PartitionNumberOf(EFI_HANDLE handle) {
  void *interface = nullptr;
  if (EFI_ERROR(gBS->HandleProtocol(handle, &gEfiDevicePathProtocolGuid, &interface)) ||
      interface == nullptr) {
    return 0;
  }
  const UINT8 *bytes = static_cast<const UINT8 *>(interface);
  for (;;) {
    const EFI_DEVICE_PATH_PROTOCOL *node = reinterpret_cast<const EFI_DEVICE_PATH_PROTOCOL *>(bytes);
    const UINTN length = NodeLength(node);
    if ((node->Type & 0x7F) == END_DEVICE_PATH_TYPE || length < sizeof(EFI_DEVICE_PATH_PROTOCOL)) {
      return 0;
    }
    if (node->Type == MEDIA_DEVICE_PATH && node->SubType == MEDIA_HARDDRIVE_DP && length >= 8) {
      return static_cast<UINT32>(bytes[4]) | static_cast<UINT32>(bytes[5]) << 8 |
             static_cast<UINT32>(bytes[6]) << 16 | static_cast<UINT32>(bytes[7]) << 24;
    }
    bytes += length;
  }
}

UINT64 ReadLe(const UINT8 *bytes, UINT32 count) {
  UINT64 value = 0;
  for (UINT32 i = count; i > 0; i--) {
    value = value << 8 | bytes[i - 1];
  }
  return value;
}

// The table's checksum again, after one of its functions was replaced.
void SealTable(EFI_TABLE_HEADER *header) {
  header->CRC32 = 0;
  UINT32 crc = 0;
  reinterpret_cast<CalculateCrc32Function>(gBS->CalculateCrc32)(header, header->HeaderSize, &crc);
  header->CRC32 = crc;
}

}  // namespace

UINT32 CountBoot() {
  UINT32 count = 0;
  UINTN size = sizeof(count);
  EFI_GUID guid = kPlatformVariableGuid;
  if (EFI_ERROR(gRT->GetVariable(kBootCountName, &guid, nullptr, &size, &count)) || size != sizeof(count)) {
    count = 0;
  } else {
    gRT->SetVariable(kBootCountName, &guid, 0, 0, nullptr);
  }
  gBootCount = ++count;
  SerialPrintf("platform: boot %u\n", static_cast<UINT64>(count));
  return count;
}

void ReportResumeVariables() {
  SerialPrintf("platform: nvram at start:");
  for (UINT32 i = 0; i < sizeof(kResumeVariables) / sizeof(kResumeVariables[0]); i++) {
    UINTN size = 0;
    const EFI_STATUS status =
        gRT->GetVariable(kResumeVariables[i], &gNimbVendorVariableGuid, nullptr, &size, nullptr);
    if (status == EFI_BUFFER_TOO_SMALL) {
      SerialPrintf(" %s=%u", kResumeVariableNames[i], static_cast<UINT64>(size));
    } else {
      SerialPrintf(" %s=absent", kResumeVariableNames[i]);
    }
  }
  SerialPrintf("\n");
}

void WatchDiskAndReset(bool timeReads) {
  gTimeReads = timeReads;
  UINTN count = 0;
  EFI_HANDLE *handles = nullptr;
  if (!EFI_ERROR(gBS->LocateHandleBuffer(ByProtocol, &gEfiDiskIoProtocolGuid, nullptr, &count, &handles))) {
    for (UINTN i = 0; i < count && gDiskCount < kMaxDiskInterfaces; i++) {
      void *interface = nullptr;
      if (EFI_ERROR(gBS->HandleProtocol(handles[i], &gEfiDiskIoProtocolGuid, &interface))) {
        continue;
      }
      EFI_DISK_IO_PROTOCOL *disk = static_cast<EFI_DISK_IO_PROTOCOL *>(interface);
      gDisks[gDiskCount++] = {disk, disk->ReadDisk, PartitionNumberOf(handles[i])};
      disk->ReadDisk = WatchedReadDisk;
    }
    gBS->FreePool(handles);
  }
  if (timeReads) {
    gOriginalGetMemoryMap = gBS->GetMemoryMap;
    gBS->GetMemoryMap = TimedGetMemoryMap;
    SealTable(&gBS->Hdr);
  }
  gBS->CreateEvent(EVT_SIGNAL_EXIT_BOOT_SERVICES, TPL_NOTIFY, NoteBootServicesEnd, nullptr,
                   &gBootServicesEndEvent);
  gOriginalReset = gRT->ResetSystem;
  gRT->ResetSystem = WatchedResetSystem;
  SealTable(&gRT->Hdr);
  SerialPrintf("platform: watching %u disk interfaces and the reset\n", static_cast<UINT64>(gDiskCount));
}

void UnwatchDiskAndReset() {
  for (UINT32 i = 0; i < gDiskCount; i++) {
    gDisks[i].interface->ReadDisk = gDisks[i].original;
  }
  gDiskCount = 0;
  if (gOriginalGetMemoryMap != nullptr) {
    gBS->GetMemoryMap = gOriginalGetMemoryMap;
    SealTable(&gBS->Hdr);
  }
  if (gOriginalReset != nullptr) {
    gRT->ResetSystem = gOriginalReset;
    SealTable(&gRT->Hdr);
  }
  // Its function lies in the image that the firmware frees.
  if (gBootServicesEndEvent != nullptr) {
    gBS->CloseEvent(gBootServicesEndEvent);
    gBootServicesEndEvent = nullptr;
  }
}

void ReportKeyCopies(const ConfigEntryList &variables) {
  const ConfigEntry *key = nullptr;
  for (UINT32 i = 0; i < variables.count; i++) {
    const char *name = variables.entries[i].name;
    const char *wanted = kResumeVariableNames[2];
    UINT32 j = 0;
    while (name[j] != 0 && name[j] == wanted[j]) {
      j++;
    }
    if (name[j] == wanted[j] && variables.entries[i].size >= 8) {
      key = &variables.entries[i];
    }
  }
  if (key == nullptr) {
    return;
  }
  UINTN size = 0, mapKey = 0, descriptorSize = 0;
  UINT32 version = 0;
  gBS->GetMemoryMap(&size, nullptr, &mapKey, &descriptorSize, &version);
  size += 4 * descriptorSize;
  UINT8 *map = nullptr;
  if (EFI_ERROR(gBS->AllocatePool(EfiBootServicesData, size, reinterpret_cast<VOID **>(&map))) ||
      EFI_ERROR(gBS->GetMemoryMap(&size, reinterpret_cast<EFI_MEMORY_DESCRIPTOR *>(map), &mapKey,
                                  &descriptorSize, &version))) {
    SerialPrintf("platform: key copies: no memory map\n");
    return;
  }
  // The key's words at each byte offset: an occurrence anywhere has one of
  // them in a 4-byte-aligned word among its first seven bytes.
  UINT32 words[4];
  for (UINT32 k = 0; k < 4; k++) {
    words[k] = static_cast<UINT32>(ReadLe(key->bytes + k, 4));
  }
  UINT32 found = 0;
  for (UINT8 *d = map; d < map + size; d += descriptorSize) {
    const EFI_MEMORY_DESCRIPTOR *descriptor = reinterpret_cast<const EFI_MEMORY_DESCRIPTOR *>(d);
    const UINT64 start = descriptor->PhysicalStart;
    const UINT64 end = start + descriptor->NumberOfPages * 4096;
    // Memory that the firmware and the programs hold data in (free memory
    // holds none of the key: the harness sees the probe find none there).
    if (descriptor->Type < EfiLoaderCode || descriptor->Type > EfiRuntimeServicesData || end > (1ull << 32)) {
      continue;
    }
    for (UINT64 at = start; at + 4 <= end; at += 4) {
      const UINT32 word = *reinterpret_cast<const volatile UINT32 *>(at);
      for (UINT32 k = 0; k < 4; k++) {
        const UINT8 *bytes = reinterpret_cast<const UINT8 *>(at - k);
        if (word != words[k] || at - k < start || at - k + key->size > end || bytes == key->bytes) {
          continue;
        }
        UINT32 i = 0;
        while (i < key->size && bytes[i] == key->bytes[i]) {
          i++;
        }
        if (i == key->size) {
          SerialPrintf("platform: key copy at 0x%x type %u\n", at - k, static_cast<UINT64>(descriptor->Type));
          found++;
        }
      }
    }
  }
  gBS->FreePool(map);
  SerialPrintf("platform: key copies %u\n", static_cast<UINT64>(found));
}

void TimedRead(const ConfigBytes &request) {
  if (request.size < 4 || (request.size - 4) % 16 != 0) {
    SerialPrintf("platform: timed read: bad request of %u bytes\n", static_cast<UINT64>(request.size));
    return;
  }
  const UINT32 partition = static_cast<UINT32>(ReadLe(request.bytes, 4));
  const UINT32 extents = (request.size - 4) / 16;
  UINT64 total = 0;
  for (UINT32 i = 0; i < extents; i++) {
    total += ReadLe(request.bytes + 4 + 16 * i + 8, 8);
  }
  UINTN count = 0;
  EFI_HANDLE *handles = nullptr;
  EFI_DISK_IO_PROTOCOL *disk = nullptr;
  UINT32 mediaId = 0;
  if (!EFI_ERROR(gBS->LocateHandleBuffer(ByProtocol, &gEfiBlockIoProtocolGuid, nullptr, &count, &handles))) {
    for (UINTN i = 0; i < count && disk == nullptr; i++) {
      void *diskInterface = nullptr;
      void *blockInterface = nullptr;
      if (PartitionNumberOf(handles[i]) == partition &&
          !EFI_ERROR(gBS->HandleProtocol(handles[i], &gEfiDiskIoProtocolGuid, &diskInterface)) &&
          !EFI_ERROR(gBS->HandleProtocol(handles[i], &gEfiBlockIoProtocolGuid, &blockInterface))) {
        disk = static_cast<EFI_DISK_IO_PROTOCOL *>(diskInterface);
        mediaId = static_cast<EFI_BLOCK_IO_PROTOCOL *>(blockInterface)->Media->MediaId;
      }
    }
    gBS->FreePool(handles);
  }
  EFI_PHYSICAL_ADDRESS buffer = 0;
  const UINTN pages = static_cast<UINTN>((total + 4095) / 4096);
  if (disk == nullptr ||
      EFI_ERROR(gBS->AllocatePages(AllocateAnyPages, EfiBootServicesData, pages, &buffer))) {
    SerialPrintf("platform: timed read: no partition %u or no memory\n", static_cast<UINT64>(partition));
    return;
  }
  EFI_STATUS status = EFI_SUCCESS;
  UINT8 *destination = reinterpret_cast<UINT8 *>(buffer);
  const UINT64 start = ReadTsc();
  for (UINT32 i = 0; i < extents && !EFI_ERROR(status); i++) {
    const UINT64 offset = ReadLe(request.bytes + 4 + 16 * i, 8);
    const UINT64 length = ReadLe(request.bytes + 4 + 16 * i + 8, 8);
    status = disk->ReadDisk(disk, mediaId, offset, static_cast<UINTN>(length), destination);
    destination += length;
  }
  const UINT64 ticks = ReadTsc() - start;
  gBS->FreePages(buffer, pages);
  SerialPrintf("platform: timed read %u bytes, %u extents, %u ticks (%s)\n", total,
               static_cast<UINT64>(extents), ticks, StatusName(status));
}

}  // namespace nimb::platform
