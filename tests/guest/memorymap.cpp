#include "memorymap.h"

#include "memory.h"
#include "report.h"

namespace nimb::guest {

namespace {

constexpr uint32_t kSparePages = 2;

struct Descriptor {
  uint32_t type;
  uint64_t physicalStart;
  uint64_t virtualStart;
  uint64_t pages;
  uint64_t attribute;
};

struct MemoryMap {
  const uint8_t *bytes;
  uint32_t count;
  uint32_t stride;
};

Descriptor DescriptorAt(const MemoryMap &map, uint32_t index) {
  const uint8_t *p = map.bytes + index * map.stride;
  return Descriptor{Le32(p + kDescriptorType), Le64(p + kDescriptorPhysicalStart),
                    Le64(p + kDescriptorVirtualStart), Le64(p + kDescriptorNumberOfPages),
                    Le64(p + kDescriptorAttribute)};
}

// Byte size of a descriptor; a page count too large for 64 bits of bytes
// counts as everything.
uint64_t ByteSize(const Descriptor &descriptor) {
  return descriptor.pages >= (1ull << 52) ? ~0ull : descriptor.pages << 12;
}

void PrintTypeName(uint32_t type) {
  const char *name = MemoryTypeName(type);
  if (name != nullptr) {
    Print("%s", name);
  } else {
    Print("0x%x", type);
  }
}

void PrintSummary(const MemoryMap &map) {
  uint32_t counts[kEfiMemoryTypeCount + 1] = {};
  uint64_t pages[kEfiMemoryTypeCount + 1] = {};
  for (uint32_t i = 0; i < map.count; i++) {
    Descriptor descriptor = DescriptorAt(map, i);
    uint32_t slot = descriptor.type < kEfiMemoryTypeCount ? descriptor.type : kEfiMemoryTypeCount;
    counts[slot]++;
    pages[slot] += descriptor.pages;
  }
  for (uint32_t type = 0; type <= kEfiMemoryTypeCount; type++) {
    if (counts[type] != 0) {
      Line("memmap type %s count=%u pages=0x%llx",
           type < kEfiMemoryTypeCount ? MemoryTypeName(type) : "other", counts[type],
           static_cast<unsigned long long>(pages[type]));
    }
  }
  for (uint32_t i = 0; i < map.count; i++) {
    Descriptor descriptor = DescriptorAt(map, i);
    if ((descriptor.attribute & kEfiMemoryRuntime) == 0) {
      continue;
    }
    LineStart();
    Print("memmap runtime ");
    PrintTypeName(descriptor.type);
    Print(" physical=0x%llx virtual=0x%llx pages=0x%llx attribute=0x%llx",
          static_cast<unsigned long long>(descriptor.physicalStart),
          static_cast<unsigned long long>(descriptor.virtualStart),
          static_cast<unsigned long long>(descriptor.pages),
          static_cast<unsigned long long>(descriptor.attribute));
    LineEnd();
  }
}

// Runtime descriptors have their new addresses in the runtime area, apart
// from each other; the moved regions (code and data) are there physically too.
void CheckRuntime(const MemoryMap &map, const KernelRegion &region) {
  uint64_t low = region.runtimeStart;
  uint64_t high = region.end - kSparePages * kPageSize;
  uint32_t runtime = 0;
  uint64_t pages = 0;
  for (uint32_t i = 0; i < map.count; i++) {
    Descriptor descriptor = DescriptorAt(map, i);
    if ((descriptor.attribute & kEfiMemoryRuntime) == 0 || descriptor.type == kEfiReservedMemoryType) {
      continue;
    }
    runtime++;
    pages += descriptor.pages;
    uint64_t size = ByteSize(descriptor);
    bool moved = descriptor.type == kEfiRuntimeServicesCode || descriptor.type == kEfiRuntimeServicesData;
    const char *problem = nullptr;
    if (!Inside(descriptor.virtualStart, size, low, high)) {
      problem = "virtual range outside the runtime area";
    } else if (moved && descriptor.physicalStart != descriptor.virtualStart) {
      problem = "moved region with physical != virtual";
    }
    for (uint32_t j = 0; j < i && problem == nullptr; j++) {
      Descriptor other = DescriptorAt(map, j);
      if ((other.attribute & kEfiMemoryRuntime) == 0 || other.type == kEfiReservedMemoryType) {
        continue;
      }
      uint64_t otherSize = ByteSize(other);
      if (descriptor.virtualStart < other.virtualStart + otherSize &&
          other.virtualStart < descriptor.virtualStart + size) {
        problem = "virtual range overlaps another runtime descriptor";
      }
    }
    if (problem != nullptr) {
      Check("memmap-runtime", false,
            "descriptor %u: %s (physical=0x%llx virtual=0x%llx pages=0x%llx; area 0x%llx-0x%llx)", i, problem,
            static_cast<unsigned long long>(descriptor.physicalStart),
            static_cast<unsigned long long>(descriptor.virtualStart),
            static_cast<unsigned long long>(descriptor.pages), static_cast<unsigned long long>(low),
            static_cast<unsigned long long>(high));
      return;
    }
  }
  Check("memmap-runtime", true, "%u runtime descriptors, 0x%llx pages in 0x%llx-0x%llx", runtime,
        static_cast<unsigned long long>(pages), static_cast<unsigned long long>(low),
        static_cast<unsigned long long>(high));
}

void CheckReserved(const MemoryMap &map) {
  for (uint32_t i = 0; i < map.count; i++) {
    Descriptor descriptor = DescriptorAt(map, i);
    if (descriptor.type == kEfiReservedMemoryType && (descriptor.attribute & kEfiMemoryRuntime) != 0) {
      Check("memmap-reserved", false, "descriptor %u: reserved memory at 0x%llx keeps the runtime attribute",
            i, static_cast<unsigned long long>(descriptor.physicalStart));
      return;
    }
  }
  Check("memmap-reserved", true, "no reserved descriptor with the runtime attribute");
}

// The first descriptor of `type` whose pages hold `address`, or -1.
int32_t Containing(const MemoryMap &map, uint64_t address, uint32_t type) {
  for (uint32_t i = 0; i < map.count; i++) {
    Descriptor descriptor = DescriptorAt(map, i);
    if (descriptor.type == type && address >= descriptor.physicalStart &&
        address - descriptor.physicalStart < ByteSize(descriptor)) {
      return static_cast<int32_t>(i);
    }
  }
  return -1;
}

void CheckLoaderData(const MemoryMap &map, const Area *areas, uint32_t count) {
  for (uint32_t a = 0; a < count; a++) {
    uint64_t cursor = areas[a].address;
    uint64_t end = cursor + areas[a].length;
    while (cursor < end) {
      int32_t index = Containing(map, cursor, kEfiLoaderData);
      if (index < 0) {
        Check("memmap-loader-data", false, "%s: 0x%llx is in no EfiLoaderData descriptor", areas[a].name,
              static_cast<unsigned long long>(cursor));
        return;
      }
      Descriptor descriptor = DescriptorAt(map, static_cast<uint32_t>(index));
      uint64_t descriptorEnd = descriptor.physicalStart + ByteSize(descriptor);
      cursor = descriptorEnd < descriptor.physicalStart ? end : descriptorEnd;
    }
  }
  Check("memmap-loader-data", true, "%u handed-over areas in EfiLoaderData memory", count);
}

}  // namespace

const char *MemoryTypeName(uint32_t type) {
  static const char *const kNames[kEfiMemoryTypeCount] = {
      "EfiReservedMemoryType",
      "EfiLoaderCode",
      "EfiLoaderData",
      "EfiBootServicesCode",
      "EfiBootServicesData",
      "EfiRuntimeServicesCode",
      "EfiRuntimeServicesData",
      "EfiConventionalMemory",
      "EfiUnusableMemory",
      "EfiACPIReclaimMemory",
      "EfiACPIMemoryNVS",
      "EfiMemoryMappedIO",
      "EfiMemoryMappedIOPortSpace",
      "EfiPalCode",
      "EfiPersistentMemory",
      "EfiUnacceptedMemoryType",
  };
  return type < kEfiMemoryTypeCount ? kNames[type] : nullptr;
}

void CheckMemoryMap(const BootArgs &args, const KernelRegion &region, const Area *areas, uint32_t count) {
  uint32_t stride = args.memoryDescriptorSize;
  uint32_t size = args.memoryMapSize;
  bool strideOk = stride >= kDescriptorMinimumSize && stride % 8 == 0;
  bool sizeOk = strideOk && size != 0 && size % stride == 0;
  const uint8_t *bytes = sizeOk ? GuestMemory(args.memoryMap, size) : nullptr;
  MemoryMap map = {bytes, sizeOk ? size / stride : 0, stride};
  Line("memmap address=0x%x size=0x%x descriptorSize=%u descriptorVersion=%u descriptors=%u", args.memoryMap,
       size, stride, args.memoryDescriptorVersion, map.count);
  if (!Check("memmap-layout", bytes != nullptr, "%u descriptors of %u bytes at 0x%x%s", map.count, stride,
             args.memoryMap,
             !strideOk ? ": descriptor size below 40 or not a multiple of 8"
             : !sizeOk ? ": size not a whole number of descriptors"
             : !bytes  ? ": unreadable"
                       : "")) {
    return;
  }
  PrintSummary(map);
  CheckRuntime(map, region);
  CheckReserved(map);
  CheckLoaderData(map, areas, count);
}

}  // namespace nimb::guest
