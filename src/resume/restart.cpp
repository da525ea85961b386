#include "resume/restart.h"

#include "boot/boot.h"
#include "boot/machine.h"
#include "boot/stop.h"
#include "memory/runtime_map.h"
#include "screen/bootscreen.h"
#include "support/strings.h"

namespace nimb {

namespace {

constexpr UINT32 kAdlerModulus = 65521;
constexpr UINTN kSumGroupBytes = 32;
constexpr UINT64 kBelow4GPages = 0x100000;

// The runtime map gives every runtime descriptor (reserved memory apart) the
// next addresses from the area's start on, one behind the other. The regions
// that are copied there, runtime code and data, must land inside the area;
// others (memory-mapped I/O) only take address space, which may run past it.
NIMB_MAP_WALK bool RuntimeAreaHolds(const UINT8 *map, UINTN mapSize, UINTN descriptorSize, UINT64 areaBytes) {
  UINT64 offset = 0;
  for (UINTN at = 0; at < mapSize; at += descriptorSize) {
    const EFI_MEMORY_DESCRIPTOR *d = reinterpret_cast<const EFI_MEMORY_DESCRIPTOR *>(map + at);
    if (d->Type == EfiReservedMemoryType || (d->Attribute & EFI_MEMORY_RUNTIME) == 0) {
      continue;
    }
    if (d->NumberOfPages > kBelow4GPages) {  // keeps the offsets from wrapping
      return false;
    }
    const UINT64 bytes = d->NumberOfPages * kResumePageBytes;
    const bool copied = d->Type == EfiRuntimeServicesCode || d->Type == EfiRuntimeServicesData;
    if (copied && (offset > areaBytes || bytes > areaBytes - offset)) {
      return false;
    }
    offset += bytes;
  }
  return true;
}

void RecordVideo(UINT8 *scratch) {
  VideoInfo video = {};
  GetFrameBufferInfo(&video);
  video.displayMode = kVideoGraphics;
  ResumeVideoRecord *record = reinterpret_cast<ResumeVideoRecord *>(scratch + kResumeVideoRecordOffset);
  record->baseAddress = video.baseAddress;
  record->displayMode = video.displayMode;
  record->rowBytes = video.rowBytes;
  record->width = video.width;
  record->height = video.height;
  record->depth = video.depth;
}

}  // namespace

UINT32 ResumeCopyRestartCode(UINT8 *destination, const UINT8 *source, UINT32 pageCount) {
  UINT32 total = 0;
  for (UINT32 page = 0; page < pageCount; page++) {
    // Over one page neither sum can wrap: a stays below 1044482, b below 2^31.
    UINT32 a = 1;
    UINT32 b = 0;
    for (UINTN group = 0; group < kResumePageBytes; group += kSumGroupBytes) {
      bcopy(source + group, destination + group, kSumGroupBytes);
      for (UINTN i = 0; i < kSumGroupBytes; i++) {
        a += destination[group + i];
        b += a;
      }
    }
    a %= kAdlerModulus;
    b %= kAdlerModulus;
    total += (b << 16) | a;
    source += kResumePageBytes;
    destination += kResumePageBytes;
  }
  return total;
}

void ResumeRestart(ResumeState *state) {
  const ResumePlan &plan = state->plan;
  ResumeHeader *header = state->header;
  RecordVideo(state->scratch);

  // The final map, and nothing but checks on it before boot services end, so
  // that its key stays valid.
  UINT8 *map = state->scratch + kResumeMemoryMapOffset;
  UINTN mapSize = plan.mapCapacity;
  UINTN mapKey = 0;
  UINTN descriptorSize = 0;
  UINT32 descriptorVersion = 0;
  const UINT64 runtimeBytes = static_cast<UINT64>(plan.runtimePageCount) * kResumePageBytes;
  if (EFI_ERROR(gBS->GetMemoryMap(&mapSize, reinterpret_cast<EFI_MEMORY_DESCRIPTOR *>(map), &mapKey,
                                  &descriptorSize, &descriptorVersion)) ||
      mapSize > plan.mapCapacity || descriptorSize < sizeof(EFI_MEMORY_DESCRIPTOR) ||
      mapSize % descriptorSize != 0 || !RuntimeAreaHolds(map, mapSize, descriptorSize, runtimeBytes)) {
    return;
  }
  if (EFI_ERROR(gBS->ExitBootServices(gImageHandle, mapKey))) {
    return;
  }
  gBS = nullptr;
  gResumeUnderway = nullptr;

  // Only the runtime services are left. They move into the image's area;
  // from here on they are reached through the moved system table.
  EFI_MEMORY_DESCRIPTOR *start = reinterpret_cast<EFI_MEMORY_DESCRIPTOR *>(map);
  EFI_MEMORY_DESCRIPTOR *cursor = start;
  UINT64 nextVirtual = plan.runtimeBase;
  MapRuntimeServices(start, reinterpret_cast<EFI_MEMORY_DESCRIPTOR *>(map + mapSize), &cursor, descriptorSize,
                     descriptorVersion, &nextVirtual, 1);
  gRT = gST->RuntimeServices;
  const UINT64 systemTableOffset = reinterpret_cast<UINT64>(gST) - plan.runtimeBase;
  header->systemTableOffset = static_cast<UINT32>(systemTableOffset);
  header->memoryMapBytes = static_cast<UINT32>(reinterpret_cast<UINT8 *>(cursor) - map);
  // The restart code finds the system table by its offset in the area: one
  // that did not move there (or sits at the area's very start) is refused.
  if (systemTableOffset == 0 || systemTableOffset >= runtimeBytes) {
    StopAfterBootServices("Resume: the system table is not in the runtime area\n", 1);
  }

  header->restoreSum = ResumeCopyRestartCode(reinterpret_cast<UINT8 *>(plan.restoreBase),
                                             reinterpret_cast<UINT8 *>(header) + plan.restartCodeOffset,
                                             plan.restorePageCount);
  const UINT32 entry = static_cast<UINT32>(plan.restoreBase + plan.restoreEntryOffset);
  MachineDisableInterrupts();
  MachineEnterGate(gCallGate, static_cast<UINT32>(reinterpret_cast<UINT64>(header)), entry);
  StopAfterBootServices("Kernel Failed!!\n", 1);
}

}  // namespace nimb
