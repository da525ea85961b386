// Physical memory: the arena mapped at its own addresses, page allocations in
// it, the memory map that describes it, and the malloc-backed pool.
#include <sys/mman.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "hostfw/internal.h"

namespace hostfw {

namespace {

constexpr UINT64 kArenaBytes = kArenaLimit - kArenaBase;
// What newly allocated memory holds, so that code which relies on zeroed
// memory fails in tests.
constexpr uint8_t kJunk = 0xAF;
constexpr UINT64 kCacheable = EFI_MEMORY_UC | EFI_MEMORY_WC | EFI_MEMORY_WT | EFI_MEMORY_WB;

UINT64 EndOf(UINT64 base, const PageRange &range) {
  return base + range.pages * EFI_PAGE_SIZE;
}

UINT64 DefaultAttribute(EFI_MEMORY_TYPE type) {
  bool runtime = type == EfiRuntimeServicesCode || type == EfiRuntimeServicesData;
  return runtime ? kCacheable | EFI_MEMORY_RUNTIME : kCacheable;
}

// A type that AllocatePages and AllocatePool accept: the standard ones but
// free memory, and the OEM and OS ranges.
bool AllocatableType(EFI_MEMORY_TYPE type) {
  UINT32 value = type;
  return (value < EfiMaxMemoryType && value != EfiConventionalMemory) || value >= 0x70000000;
}

bool InArena(UINT64 base, UINT64 pages) {
  return base >= kArenaBase && base < kArenaLimit && pages <= (kArenaLimit - base) >> EFI_PAGE_SHIFT;
}

bool IsFree(const State &s, UINT64 base, UINT64 pages) {
  UINT64 end = base + pages * EFI_PAGE_SIZE;
  auto next = s.ranges.lower_bound(base);
  if (next != s.ranges.end() && next->first < end)
    return false;
  if (next != s.ranges.begin()) {
    auto previous = std::prev(next);
    if (EndOf(previous->first, previous->second) > base)
      return false;
  }
  return true;
}

struct Stretch {
  UINT64 start;
  UINT64 end;
};

// The free parts of the arena, highest first.
std::vector<Stretch> FreeStretches(const State &s) {
  std::vector<Stretch> free;
  UINT64 cursor = kArenaBase;
  for (const auto &[base, range] : s.ranges) {
    if (base > cursor)
      free.push_back({cursor, base});
    cursor = EndOf(base, range);
  }
  if (cursor < kArenaLimit)
    free.push_back({cursor, kArenaLimit});
  std::reverse(free.begin(), free.end());
  return free;
}

// The highest place for `pages` pages that ends at or below `limit`.
bool FindTopDown(const State &s, UINT64 pages, UINT64 limit, UINT64 *base) {
  if (pages == 0)
    return false;
  for (const Stretch &free : FreeStretches(s)) {
    UINT64 end = std::min(free.end, limit);
    if (end > free.start && (end - free.start) >> EFI_PAGE_SHIFT >= pages) {
      *base = end - pages * EFI_PAGE_SIZE;
      return true;
    }
  }
  return false;
}

// Under the guard, free memory and declared reserved memory can be neither
// read nor written.
bool Closed(const PageRange &range) {
  return range.owner == Owner::Declared && range.type == EfiReservedMemoryType;
}

void Protect(UINT64 base, UINT64 pages, bool open) {
  if (mprotect(reinterpret_cast<void *>(base), pages * EFI_PAGE_SIZE,
               open ? PROT_READ | PROT_WRITE : PROT_NONE) != 0) {
    Misuse("cannot protect %#llx: %s", static_cast<unsigned long long>(base), std::strerror(errno));
  }
}

void Occupy(State &s, UINT64 base, UINT64 pages, EFI_MEMORY_TYPE type, UINT64 attribute, Owner owner) {
  s.ranges[base] = {pages, type, attribute, owner};
  s.mapKey++;
  if (s.guarded && !Closed(s.ranges[base]))
    Protect(base, pages, true);
}

EFI_STATUS FindPages(const State &s, EFI_ALLOCATE_TYPE type, UINT64 pages, UINT64 request, UINT64 *base) {
  if (type == AllocateAddress) {
    if (pages == 0 || request % EFI_PAGE_SIZE != 0 || !InArena(request, pages) ||
        !IsFree(s, request, pages)) {
      return EFI_NOT_FOUND;
    }
    *base = request;
    return EFI_SUCCESS;
  }
  // Below 4 GiB in any case, as the arena is; AllocateMaxAddress wants the
  // last byte at or below `request`.
  UINT64 limit = kArenaLimit;
  if (type == AllocateMaxAddress && request < kArenaLimit)
    limit = (request + 1) & ~(EFI_PAGE_SIZE - 1);
  return FindTopDown(s, pages, limit, base) ? EFI_SUCCESS : EFI_OUT_OF_RESOURCES;
}

std::vector<EFI_MEMORY_DESCRIPTOR> BuildMap(const State &s) {
  std::vector<EFI_MEMORY_DESCRIPTOR> parts = s.outsideRegions;
  for (const auto &[base, range] : s.ranges)
    parts.push_back({range.type, 0, base, 0, range.pages, range.attribute});
  for (const Stretch &free : FreeStretches(s)) {
    parts.push_back(
        {EfiConventionalMemory, 0, free.start, 0, (free.end - free.start) >> EFI_PAGE_SHIFT, kCacheable});
  }
  std::sort(parts.begin(), parts.end(), [](const EFI_MEMORY_DESCRIPTOR &a, const EFI_MEMORY_DESCRIPTOR &b) {
    return a.PhysicalStart < b.PhysicalStart;
  });
  // Adjacent ranges of the same type and attributes are one descriptor.
  std::vector<EFI_MEMORY_DESCRIPTOR> map;
  for (const EFI_MEMORY_DESCRIPTOR &part : parts) {
    if (!map.empty()) {
      EFI_MEMORY_DESCRIPTOR &last = map.back();
      if (last.Type == part.Type && last.Attribute == part.Attribute &&
          last.PhysicalStart + last.NumberOfPages * EFI_PAGE_SIZE == part.PhysicalStart) {
        last.NumberOfPages += part.NumberOfPages;
        continue;
      }
    }
    map.push_back(part);
  }
  return map;
}

// The firmware's own allocations between two reads of the map: one page
// each, at the top of the highest free stretch, of a type that differs from
// the range above it, so that each adds exactly one descriptor.
void ApplyGrowth(State &s) {
  for (; s.pendingGrowth > 0; s.pendingGrowth--) {
    bool placed = false;
    for (const Stretch &free : FreeStretches(s)) {
      if (free.end - free.start < 2 * EFI_PAGE_SIZE)
        continue;
      auto above = s.ranges.find(free.end);
      const EFI_MEMORY_TYPE data = s.growthRuntime ? EfiRuntimeServicesData : EfiBootServicesData;
      const EFI_MEMORY_TYPE code = s.growthRuntime ? EfiRuntimeServicesCode : EfiBootServicesCode;
      bool aboveIsData = above != s.ranges.end() && above->second.type == data;
      UINT64 base = free.end - EFI_PAGE_SIZE;
      Occupy(s, base, 1, aboveIsData ? code : data, kCacheable | (s.growthRuntime ? EFI_MEMORY_RUNTIME : 0),
             Owner::Firmware);
      std::memset(reinterpret_cast<void *>(base), 0, EFI_PAGE_SIZE);
      placed = true;
      break;
    }
    if (!placed)
      Misuse("no free memory left to grow the memory map");
  }
}

void *NewPoolBlock(State &s, size_t size, EFI_MEMORY_TYPE type) {
  void *block = std::malloc(size == 0 ? 1 : size);
  if (block == nullptr)
    Misuse("the host is out of memory for a pool block of %zu bytes", size);
  std::memset(block, kJunk, size);
  s.pool[block] = {size, type};
  s.mapKey++;
  return block;
}

// --- Services -------------------------------------------------------------------

EFI_STATUS EFIAPI AllocatePages(EFI_ALLOCATE_TYPE Type, EFI_MEMORY_TYPE MemoryType, UINTN Pages,
                                EFI_PHYSICAL_ADDRESS *Memory) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "AllocatePages", &failure))
    return failure;
  if (Type >= MaxAllocateType || !AllocatableType(MemoryType) || Memory == nullptr)
    return EFI_INVALID_PARAMETER;
  UINT64 base;
  EFI_STATUS status = FindPages(s, Type, Pages, *Memory, &base);
  if (EFI_ERROR(status))
    return status;
  Occupy(s, base, Pages, MemoryType, DefaultAttribute(MemoryType), Owner::Loader);
  std::memset(reinterpret_cast<void *>(base), kJunk, Pages * EFI_PAGE_SIZE);
  *Memory = base;
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI FreePages(EFI_PHYSICAL_ADDRESS Memory, UINTN Pages) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "FreePages", &failure))
    return failure;
  if (Memory % EFI_PAGE_SIZE != 0)
    return EFI_INVALID_PARAMETER;
  auto it = s.ranges.find(Memory);
  if (it == s.ranges.end() || it->second.owner != Owner::Loader || it->second.pages != Pages)
    return EFI_NOT_FOUND;
  s.ranges.erase(it);
  s.mapKey++;
  madvise(reinterpret_cast<void *>(Memory), Pages * EFI_PAGE_SIZE, MADV_DONTNEED);
  if (s.guarded)
    Protect(Memory, Pages, false);
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI GetMemoryMap(UINTN *MemoryMapSize, EFI_MEMORY_DESCRIPTOR *MemoryMap, UINTN *MapKey,
                               UINTN *DescriptorSize, UINT32 *DescriptorVersion) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "GetMemoryMap", &failure))
    return failure;
  if (MemoryMapSize == nullptr)
    return EFI_INVALID_PARAMETER;
  if (s.growthCountdown > 0 && --s.growthCountdown == 0) {
    s.pendingGrowth += s.growthLater;
    s.growthLater = 0;
  }
  ApplyGrowth(s);
  std::vector<EFI_MEMORY_DESCRIPTOR> map = BuildMap(s);
  UINTN needed = map.size() * kDescriptorSize;
  if (DescriptorSize != nullptr)
    *DescriptorSize = kDescriptorSize;
  if (DescriptorVersion != nullptr)
    *DescriptorVersion = EFI_MEMORY_DESCRIPTOR_VERSION;
  if (*MemoryMapSize < needed) {
    *MemoryMapSize = needed;
    return EFI_BUFFER_TOO_SMALL;
  }
  if (MemoryMap == nullptr)
    return EFI_INVALID_PARAMETER;
  auto *out = reinterpret_cast<uint8_t *>(MemoryMap);
  for (size_t i = 0; i < map.size(); i++) {
    std::memset(out + i * kDescriptorSize, 0, kDescriptorSize);
    std::memcpy(out + i * kDescriptorSize, &map[i], sizeof(EFI_MEMORY_DESCRIPTOR));
  }
  *MemoryMapSize = needed;
  if (MapKey != nullptr)
    *MapKey = s.mapKey;
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI AllocatePool(EFI_MEMORY_TYPE PoolType, UINTN Size, VOID **Buffer) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "AllocatePool", &failure, nullptr, &Size))
    return failure;
  if (!AllocatableType(PoolType) || Buffer == nullptr)
    return EFI_INVALID_PARAMETER;
  if (Size > kArenaBytes)
    return EFI_OUT_OF_RESOURCES;
  *Buffer = NewPoolBlock(s, Size, PoolType);
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI FreePool(VOID *Buffer) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "FreePool", &failure))
    return failure;
  auto it = s.pool.find(Buffer);
  if (it == s.pool.end())
    return EFI_INVALID_PARAMETER;
  std::free(Buffer);
  s.pool.erase(it);
  s.mapKey++;
  return EFI_SUCCESS;
}

VOID EFIAPI CopyMem(VOID *Destination, const VOID *Source, UINTN Length) {
  if (CalledAfterExit(Services::Active(), "CopyMem"))
    return;
  if (Length != 0)
    std::memmove(Destination, Source, Length);
}

VOID EFIAPI SetMem(VOID *Buffer, UINTN Size, UINT8 Value) {
  if (CalledAfterExit(Services::Active(), "SetMem"))
    return;
  if (Size != 0)
    std::memset(Buffer, Value, Size);
}

}  // namespace

// --- Shared with the other parts --------------------------------------------------

void MapArena() {
  static bool mapped = false;
  if (mapped)
    return;
  void *want = reinterpret_cast<void *>(kArenaBase);
  void *got = mmap(want, kArenaBytes, PROT_READ | PROT_WRITE,
                   MAP_FIXED_NOREPLACE | MAP_NORESERVE | MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
  if (got != want) {
    Misuse("cannot map the arena at %#llx: %s", static_cast<unsigned long long>(kArenaBase),
           got == MAP_FAILED ? std::strerror(errno) : "the range is taken");
  }
  mapped = true;
}

void ClearArena() {
  Protect(kArenaBase, kArenaBytes / EFI_PAGE_SIZE, true);
  madvise(reinterpret_cast<void *>(kArenaBase), kArenaBytes, MADV_DONTNEED);
}

void ApplyGuard(State &s) {
  s.guarded = true;
  for (const Stretch &free : FreeStretches(s))
    Protect(free.start, (free.end - free.start) / EFI_PAGE_SIZE, false);
  for (const auto &[base, range] : s.ranges) {
    if (Closed(range))
      Protect(base, range.pages, false);
  }
}

UINT64 AllocateFirmwarePages(State &s, EFI_MEMORY_TYPE type, UINT64 pages, uint8_t fill) {
  UINT64 base;
  if (!FindTopDown(s, pages, kArenaLimit, &base))
    Misuse("no room in the arena for the firmware's own pages");
  Occupy(s, base, pages, type, DefaultAttribute(type), Owner::Firmware);
  std::memset(reinterpret_cast<void *>(base), fill, pages * EFI_PAGE_SIZE);
  return base;
}

void *AllocateLoaderPool(State &s, size_t size, EFI_MEMORY_TYPE type) {
  return NewPoolBlock(s, size, type);
}

void SaveArena(State &s) {
  if (s.guarded)
    Protect(kArenaBase, kArenaBytes / EFI_PAGE_SIZE, true);
  for (const auto &[base, range] : s.ranges) {
    const auto *bytes = reinterpret_cast<const uint8_t *>(base);
    s.saved.push_back({base, std::vector<uint8_t>(bytes, bytes + range.pages * EFI_PAGE_SIZE)});
  }
}

void RestoreArena(State &s) {
  for (const SavedRange &range : s.saved) {
    std::memcpy(reinterpret_cast<void *>(range.base), range.bytes.data(), range.bytes.size());
  }
  s.saved.clear();
}

void FreeAllPool(State &s) {
  for (const auto &block : s.pool)
    std::free(block.first);
  s.pool.clear();
}

void InstallMemoryServices(EFI_BOOT_SERVICES &bs) {
  bs.AllocatePages = AllocatePages;
  bs.FreePages = FreePages;
  bs.GetMemoryMap = GetMemoryMap;
  bs.AllocatePool = AllocatePool;
  bs.FreePool = FreePool;
  bs.CopyMem = CopyMem;
  bs.SetMem = SetMem;
}

// --- The test's view --------------------------------------------------------------

std::vector<EFI_MEMORY_DESCRIPTOR> Firmware::MemoryMap() const {
  return BuildMap(*s_);
}

void Firmware::AddMemoryRegion(EFI_MEMORY_TYPE type, UINT64 base, UINT64 pages, UINT64 attribute) {
  if (pages == 0 || base % EFI_PAGE_SIZE != 0 || pages > (~0ULL - base) >> EFI_PAGE_SHIFT) {
    Misuse("AddMemoryRegion needs whole pages: %#llx, %llu pages", static_cast<unsigned long long>(base),
           static_cast<unsigned long long>(pages));
  }
  State &s = *s_;
  UINT64 end = base + pages * EFI_PAGE_SIZE;
  if (InArena(base, pages)) {
    if (!IsFree(s, base, pages))
      Misuse("AddMemoryRegion at %#llx overlaps memory in use", (unsigned long long)base);
    Occupy(s, base, pages, type, attribute, Owner::Declared);
    return;
  }
  if (base < kArenaLimit && end > kArenaBase)
    Misuse("AddMemoryRegion at %#llx straddles the arena", (unsigned long long)base);
  for (const EFI_MEMORY_DESCRIPTOR &other : s.outsideRegions) {
    if (base < other.PhysicalStart + other.NumberOfPages * EFI_PAGE_SIZE && other.PhysicalStart < end) {
      Misuse("AddMemoryRegion at %#llx overlaps another region", (unsigned long long)base);
    }
  }
  s.outsideRegions.push_back({type, 0, base, 0, pages, attribute});
  s.mapKey++;
}

UINT64 Firmware::AllocatedPages() const {
  UINT64 pages = 0;
  for (const auto &entry : s_->ranges) {
    if (entry.second.owner == Owner::Loader)
      pages += entry.second.pages;
  }
  return pages;
}

size_t Firmware::LivePoolBlocks() const {
  return s_->pool.size();
}
unsigned Firmware::AllocatePoolCalls() const {
  return CallCount("AllocatePool");
}
unsigned Firmware::FreePoolCalls() const {
  return CallCount("FreePool");
}
unsigned Firmware::AllocatePagesCalls() const {
  return CallCount("AllocatePages");
}
unsigned Firmware::FreePagesCalls() const {
  return CallCount("FreePages");
}
UINTN Firmware::MapKey() const {
  return s_->mapKey;
}
void Firmware::GrowMemoryMapOnCall(unsigned nth, unsigned extraDescriptors, bool runtime) {
  if (nth == 0)
    Misuse("GrowMemoryMapOnCall counts from 1");
  s_->growthCountdown = nth;
  s_->growthLater = extraDescriptors;
  s_->growthRuntime = runtime;
}

void Firmware::GuardFreeMemory() {
  ApplyGuard(*s_);
}

void Firmware::GrowMemoryMapOnNextCall(unsigned extraDescriptors) {
  s_->pendingGrowth += extraDescriptors;
}

}  // namespace hostfw
