#include "memory/runtime_map.h"

#include "boot/boot.h"
#include "boot/stop.h"
#include "support/strings.h"

namespace nimb {

namespace {

// The map is an array of descriptors whose stride is the firmware's
// descriptor size, which may exceed the structure: it is stepped in bytes.
UINT8 *Bytes(EFI_MEMORY_DESCRIPTOR *descriptor) {
  return reinterpret_cast<UINT8 *>(descriptor);
}

EFI_MEMORY_DESCRIPTOR *Next(EFI_MEMORY_DESCRIPTOR *descriptor, UINT64 descriptorSize) {
  return reinterpret_cast<EFI_MEMORY_DESCRIPTOR *>(Bytes(descriptor) + descriptorSize);
}

const EFI_MEMORY_DESCRIPTOR *Next(const EFI_MEMORY_DESCRIPTOR *descriptor, UINT64 descriptorSize) {
  return reinterpret_cast<const EFI_MEMORY_DESCRIPTOR *>(reinterpret_cast<const UINT8 *>(descriptor) +
                                                         descriptorSize);
}

void *Pointer(UINT64 address) {
  return reinterpret_cast<void *>(static_cast<UINTN>(address));
}

UINT64 Address(const void *pointer) {
  return reinterpret_cast<UINTN>(pointer);
}

NIMB_MAP_WALK UINT64 ByteSize(const EFI_MEMORY_DESCRIPTOR *descriptor) {
  return LShiftU64(descriptor->NumberOfPages, EFI_PAGE_SHIFT);
}

// Code and data of the runtime services: the regions that move. Other
// descriptors with the runtime bit (memory-mapped I/O) only get an address.
NIMB_MAP_WALK bool IsRuntimeRegion(const EFI_MEMORY_DESCRIPTOR *descriptor) {
  return descriptor->Type == EfiRuntimeServicesCode || descriptor->Type == EfiRuntimeServicesData;
}

// A descriptor that gets an address in the runtime area.
NIMB_MAP_WALK bool GetsRuntimeAddress(const EFI_MEMORY_DESCRIPTOR *descriptor) {
  return descriptor->Type != EfiReservedMemoryType && (descriptor->Attribute & EFI_MEMORY_RUNTIME) != 0;
}

// The descriptor's own words; whatever a larger stride holds behind them is
// left alone.
NIMB_MAP_WALK void CopyDescriptor(const EFI_MEMORY_DESCRIPTOR *from, EFI_MEMORY_DESCRIPTOR *to) {
  to->Type = from->Type;
  to->Pad = from->Pad;
  to->PhysicalStart = from->PhysicalStart;
  to->VirtualStart = from->VirtualStart;
  to->NumberOfPages = from->NumberOfPages;
  to->Attribute = from->Attribute;
}

// From `start` up to but not including `start` + `size`; an address below
// `start` wraps round to a distance far beyond any size.
bool InRange(UINT64 address, UINT64 start, UINT64 size) {
  return address - start < size;
}

bool Overlap(UINT64 a, UINT64 aSize, UINT64 b, UINT64 bSize) {
  return a < b + bSize && b < a + aSize;
}

// Marks a region whose copy is still to come, in the descriptor's padding
// word, which means nothing to the firmware or the kernel.
constexpr UINT32 kCopyPending = 0x80000000;

// Copies every runtime region of the list to its new place. A region goes
// once no other region still waiting has its old place under the new one;
// its own old place may overlap it. False when the regions that are left
// wait on each other.
NIMB_MAP_WALK bool CopyRegions(EFI_MEMORY_DESCRIPTOR *listStart, EFI_MEMORY_DESCRIPTOR *listEnd,
                               UINT64 descriptorSize) {
  UINTN waiting = 0;
  for (EFI_MEMORY_DESCRIPTOR *d = listStart; d < listEnd; d = Next(d, descriptorSize)) {
    d->Pad &= ~kCopyPending;
    if (IsRuntimeRegion(d)) {
      d->Pad |= kCopyPending;
      waiting++;
    }
  }
  while (waiting > 0) {
    UINTN copied = 0;
    for (EFI_MEMORY_DESCRIPTOR *d = listStart; d < listEnd; d = Next(d, descriptorSize)) {
      if ((d->Pad & kCopyPending) == 0) {
        continue;
      }
      bool blocked = false;
      for (EFI_MEMORY_DESCRIPTOR *o = listStart; o < listEnd && !blocked; o = Next(o, descriptorSize)) {
        blocked = o != d && (o->Pad & kCopyPending) != 0 &&
                  Overlap(d->VirtualStart, ByteSize(d), o->PhysicalStart, ByteSize(o));
      }
      if (!blocked) {
        memmove(Pointer(d->VirtualStart), Pointer(d->PhysicalStart), static_cast<UINTN>(ByteSize(d)));
        d->Pad &= ~kCopyPending;
        waiting--;
        copied++;
      }
    }
    if (copied == 0) {
      return false;
    }
  }
  return true;
}

// Zeroes the range from `start` of `size` bytes, except where it meets the
// runtime area from `areaStart` up to `areaEnd`: what lies there has moved in.
void ZeroOutside(UINT64 start, UINT64 size, UINT64 areaStart, UINT64 areaEnd) {
  UINT64 end = start + size;
  if (end <= areaStart || start >= areaEnd) {
    bzero(Pointer(start), static_cast<UINTN>(size));
    return;
  }
  if (start < areaStart) {
    bzero(Pointer(start), static_cast<UINTN>(areaStart - start));
  }
  if (end > areaEnd) {
    bzero(Pointer(areaEnd), static_cast<UINTN>(end - areaEnd));
  }
}

// Moves the configuration table's entries and gST that lie in the old place
// of `region` by the distance of its move. The table is reached through gST,
// so that it is found where an earlier region's move left it.
NIMB_MAP_WALK void FollowRegion(const EFI_MEMORY_DESCRIPTOR *region) {
  UINT64 start = region->PhysicalStart;
  UINT64 size = ByteSize(region);
  UINT64 delta = region->VirtualStart - start;
  EFI_CONFIGURATION_TABLE *table = gST->ConfigurationTable;
  for (UINTN i = 0; i < gST->NumberOfTableEntries; i++) {
    UINT64 address = Address(table[i].VendorTable);
    if (InRange(address, start, size)) {
      table[i].VendorTable = Pointer(address + delta);
    }
  }
  UINT64 systemTable = Address(gST);
  if (InRange(systemTable, start, size)) {
    gST = static_cast<EFI_SYSTEM_TABLE *>(Pointer(systemTable + delta));
  }
}

// Whether [start, end) lies wholly in conventional memory of the map.
bool IsConventional(const EFI_MEMORY_DESCRIPTOR *mapStart, const EFI_MEMORY_DESCRIPTOR *mapEnd,
                    UINT64 descriptorSize, UINT64 start, UINT64 end) {
  // From `start`, step from one conventional descriptor that holds the
  // address to that descriptor's end.
  UINT64 at = start;
  while (at < end) {
    UINT64 reached = at;
    for (const EFI_MEMORY_DESCRIPTOR *d = mapStart; d < mapEnd; d = Next(d, descriptorSize)) {
      if (d->Type == EfiConventionalMemory && InRange(at, d->PhysicalStart, ByteSize(d))) {
        reached = d->PhysicalStart + ByteSize(d);
        break;
      }
    }
    if (reached == at) {
      return false;
    }
    at = reached;
  }
  return true;
}

}  // namespace

UINT64 LShiftU64(UINT64 value, UINTN count) {
  return count < 64 ? value << count : 0;
}

NIMB_MAP_WALK BOOLEAN RuntimeAreaIsFree(const EFI_MEMORY_DESCRIPTOR *mapStart,
                                        const EFI_MEMORY_DESCRIPTOR *mapEnd, UINT64 descriptorSize,
                                        UINT64 areaStart, UINT64 spareBytes) {
  constexpr UINT64 kAddressLimit = 0x100000000;
  if (descriptorSize < sizeof(EFI_MEMORY_DESCRIPTOR) || areaStart >= kAddressLimit ||
      spareBytes > kAddressLimit) {
    return FALSE;
  }
  // The addresses as the move gives them out. Only the regions that are
  // copied need free memory at their new place: memory-mapped I/O only takes
  // up addresses, and nothing is written there.
  UINT64 next = areaStart;
  for (const EFI_MEMORY_DESCRIPTOR *d = mapStart; d < mapEnd; d = Next(d, descriptorSize)) {
    if (!GetsRuntimeAddress(d)) {
      continue;
    }
    const UINT64 size = ByteSize(d);
    if (size > kAddressLimit - next) {
      return FALSE;
    }
    if (IsRuntimeRegion(d) && !IsConventional(mapStart, mapEnd, descriptorSize, next, next + size)) {
      return FALSE;
    }
    next += size;
  }
  // The spare pages behind the area are only counted in the kernel region:
  // nothing is written there, but the kernel reaches them in 32 bits.
  return spareBytes <= kAddressLimit - next;
}

NIMB_MAP_WALK EFI_STATUS MapRuntimeServices(EFI_MEMORY_DESCRIPTOR *mapStart, EFI_MEMORY_DESCRIPTOR *mapEnd,
                                            EFI_MEMORY_DESCRIPTOR **cursor, UINT64 descriptorSize,
                                            UINT32 descriptorVersion, UINT64 *nextVirtual, BOOLEAN resume) {
  // Addresses, and in resume mode the compaction to the runtime descriptors.
  const UINT64 areaStart = *nextVirtual;
  UINT64 next = areaStart;
  EFI_MEMORY_DESCRIPTOR *write = *cursor;
  for (EFI_MEMORY_DESCRIPTOR *d = mapStart; d < mapEnd; d = Next(d, descriptorSize)) {
    if (d->Type == EfiReservedMemoryType) {
      d->Attribute &= ~EFI_MEMORY_RUNTIME;
    } else if (GetsRuntimeAddress(d)) {
      d->VirtualStart = next;
      next += ByteSize(d);
      if (resume != 0) {
        CopyDescriptor(d, write);
        write = Next(write, descriptorSize);
      }
    }
  }
  *nextVirtual = next;
  EFI_MEMORY_DESCRIPTOR *listEnd = mapEnd;
  if (resume != 0) {
    *cursor = write;
    listEnd = write;
  }

  EFI_STATUS status =
      gRT->SetVirtualAddressMap(static_cast<UINTN>(Bytes(listEnd) - Bytes(mapStart)),
                                static_cast<UINTN>(descriptorSize), descriptorVersion, mapStart);
  if (EFI_ERROR(status)) {
    StopAfterBootServices("Error in SetVirtualAddressMap\n", resume);
  }

  if (!CopyRegions(mapStart, listEnd, descriptorSize)) {
    StopAfterBootServices("Runtime regions overlap\n", resume);
  }

  for (EFI_MEMORY_DESCRIPTOR *d = mapStart; d < listEnd; d = Next(d, descriptorSize)) {
    if (IsRuntimeRegion(d)) {
      FollowRegion(d);
    }
  }

  write = *cursor;
  for (EFI_MEMORY_DESCRIPTOR *d = mapStart; d < listEnd; d = Next(d, descriptorSize)) {
    if (!IsRuntimeRegion(d)) {
      continue;
    }
    if (resume != 0) {
      d->PhysicalStart = d->VirtualStart;
      continue;
    }
    CopyDescriptor(d, write);
    write->PhysicalStart = d->VirtualStart;
    write = Next(write, descriptorSize);
    ZeroOutside(d->PhysicalStart, ByteSize(d), areaStart, next);
    d->Type = EfiConventionalMemory;
    d->Attribute &= ~EFI_MEMORY_RUNTIME;
  }
  *cursor = write;
  return 0;
}

}  // namespace nimb
