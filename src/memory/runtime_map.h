// The runtime address map: behind ExitBootServices, the firmware's runtime
// regions are announced at new addresses and copied there, so that the
// kernel finds the runtime services in memory of its own, with virtual
// addresses equal to physical ones.
#pragma once

#include "efi/efi.h"

// A memory map may lie only 4-byte aligned: the resume's lies at offset 788
// of its scratch area, a layout the restart code relies on. The processor
// reads descriptors there as they stand; the routines that walk a map say so
// to the host build's alignment check.
#define NIMB_MAP_WALK __attribute__((no_sanitize("alignment")))

namespace nimb {

// `value` shifted left by `count` bits, in 64 bits; 0 for a count of 64 or
// more.
UINT64 LShiftU64(UINT64 value, UINTN count);

// True when the places that MapRuntimeServices will copy runtime regions to,
// from `areaStart` on, lie wholly in conventional memory of the map, so that
// the move overwrites nothing that is in use, and when the whole area with
// `spareBytes` behind it stays below 4 GiB, where the kernel reaches it with
// 32-bit addresses. Memory-mapped I/O takes up addresses only.
BOOLEAN RuntimeAreaIsFree(const EFI_MEMORY_DESCRIPTOR *mapStart, const EFI_MEMORY_DESCRIPTOR *mapEnd,
                          UINT64 descriptorSize, UINT64 areaStart, UINT64 spareBytes);

// Walks the memory map from `mapStart` to `mapEnd` by `descriptorSize`.
// Each descriptor with EFI_MEMORY_RUNTIME (reserved memory apart, which
// loses the bit) gets the next addresses from *nextVirtual on; *nextVirtual
// comes back behind the last. The map goes to SetVirtualAddressMap, each
// runtime code or data region is copied to its new address, and the
// configuration table's entries and gST follow their regions. The copies run
// in an order in which none overwrites a region that has yet to move; a
// region's new place may overlap its own old one.
//
// Normal boot (`resume` 0): *cursor starts at `mapEnd`, with room behind it
// for one descriptor per runtime region; a descriptor of the region at its
// new place is written there, and the old one becomes zeroed conventional
// memory. Resume: *cursor starts at `mapStart`; the list is compacted in
// place to the runtime descriptors alone, at their new addresses, and only
// those are announced. Either way *cursor comes back at the end of the list.
//
// Returns 0. If the firmware refuses the map, or the regions' new places lie
// over each other's old ones in a ring that no order of copies can undo, the
// run stops here (boot services are gone by then) and the call does not
// return.
EFI_STATUS MapRuntimeServices(EFI_MEMORY_DESCRIPTOR *mapStart, EFI_MEMORY_DESCRIPTOR *mapEnd,
                              EFI_MEMORY_DESCRIPTOR **cursor, UINT64 descriptorSize, UINT32 descriptorVersion,
                              UINT64 *nextVirtual, BOOLEAN resume);

}  // namespace nimb
