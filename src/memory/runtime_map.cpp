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

void *Pointer(UINT64 address) {
  return reinterpret_cast<void *>(static_cast<UINTN>(address));
}

UINT64 Address(const void *pointer) {
  return reinterpret_cast<UINTN>(pointer);
}

UINT64 ByteSize(const EFI_MEMORY_DESCRIPTOR *descriptor) {
  return LShiftU64(descriptor->NumberOfPages, EFI_PAGE_SHIFT);
}

// Code and data of the runtime services: the regions that move. Other
// descriptors with the runtime bit (memory-mapped I/O) only get an address.
bool IsRuntimeRegion(const EFI_MEMORY_DESCRIPTOR *descriptor) {
  return descriptor->Type == EfiRuntimeServicesCode || descriptor->Type == EfiRuntimeServicesData;
}

// The descriptor's own words; whatever a larger stride holds behind them is
// left alone.
void CopyDescriptor(const EFI_MEMORY_DESCRIPTOR *from, EFI_MEMORY_DESCRIPTOR *to) {
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

// Moves the configuration table's entries and gST that lie in the old place
// of `region` by the distance of its move. The table is reached through gST,
// so that it is found where an earlier region's move left it.
void FollowRegion(const EFI_MEMORY_DESCRIPTOR *region) {
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

}  // namespace

UINT64 LShiftU64(UINT64 value, UINTN count) {
  return count < 64 ? value << count : 0;
}

EFI_STATUS MapRuntimeServices(EFI_MEMORY_DESCRIPTOR *mapStart, EFI_MEMORY_DESCRIPTOR *mapEnd,
                              EFI_MEMORY_DESCRIPTOR **cursor, UINT64 descriptorSize, UINT32 descriptorVersion,
                              UINT64 *nextVirtual, BOOLEAN resume) {
  // Addresses, and in resume mode the compaction to the runtime descriptors.
  UINT64 next = *nextVirtual;
  EFI_MEMORY_DESCRIPTOR *write = *cursor;
  for (EFI_MEMORY_DESCRIPTOR *d = mapStart; d < mapEnd; d = Next(d, descriptorSize)) {
    if (d->Type == EfiReservedMemoryType) {
      d->Attribute &= ~EFI_MEMORY_RUNTIME;
    } else if ((d->Attribute & EFI_MEMORY_RUNTIME) != 0) {
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

  for (EFI_MEMORY_DESCRIPTOR *d = mapStart; d < listEnd; d = Next(d, descriptorSize)) {
    if (IsRuntimeRegion(d)) {
      bcopy(Pointer(d->PhysicalStart), Pointer(d->VirtualStart), static_cast<UINTN>(ByteSize(d)));
    }
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
    bzero(Pointer(d->PhysicalStart), static_cast<UINTN>(ByteSize(d)));
    d->Type = EfiConventionalMemory;
    d->Attribute &= ~EFI_MEMORY_RUNTIME;
  }
  *cursor = write;
  return 0;
}

}  // namespace nimb
