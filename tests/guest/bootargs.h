// What the kernel is handed, as a 32-bit program sees it: the boot record,
// the firmware's memory descriptors and the two firmware tables it follows.
// The loader's own definition of the record is src/boot/bootinfo.h; this copy
// has the same layout, and the host test compares the two field by field.
#pragma once

#include <stddef.h>
#include <stdint.h>

namespace nimb::guest {

struct BootArgs {
  uint16_t revision;
  uint16_t version;
  char commandLine[1024];
  uint32_t memoryMap;
  uint32_t memoryMapSize;
  uint32_t memoryDescriptorSize;
  uint32_t memoryDescriptorVersion;
  uint32_t videoBaseAddress;
  uint32_t videoDisplayMode;
  uint32_t videoRowBytes;
  uint32_t videoWidth;
  uint32_t videoHeight;
  uint32_t videoDepth;
  uint32_t deviceTree;
  uint32_t deviceTreeLength;
  uint32_t kernelRegionBase;
  uint32_t kernelRegionSize;
  uint32_t runtimePageStart;
  uint32_t runtimePageCount;
  uint32_t systemTable;
  uint8_t firmwareBits;
  uint8_t reserved[31];
};

static_assert(sizeof(BootArgs) == 0x468, "the kernel reads 1128 bytes");
static_assert(offsetof(BootArgs, commandLine) == 0x004);
static_assert(offsetof(BootArgs, memoryMap) == 0x404);
static_assert(offsetof(BootArgs, memoryDescriptorVersion) == 0x410);
static_assert(offsetof(BootArgs, videoBaseAddress) == 0x414);
static_assert(offsetof(BootArgs, videoDepth) == 0x428);
static_assert(offsetof(BootArgs, deviceTree) == 0x42C);
static_assert(offsetof(BootArgs, kernelRegionBase) == 0x434);
static_assert(offsetof(BootArgs, runtimePageStart) == 0x43C);
static_assert(offsetof(BootArgs, systemTable) == 0x444);
static_assert(offsetof(BootArgs, firmwareBits) == 0x448);

constexpr uint16_t kBootArgsRevision = 4;
constexpr uint16_t kBootArgsVersion = 1;
constexpr uint8_t kFirmwareBits = 0x40;
constexpr uint32_t kDisplayModeGraphics = 1;
constexpr uint32_t kDisplayModeText = 2;
constexpr uint32_t kPageSize = 4096;

// A memory descriptor of the 64-bit firmware, read by offset: the map's
// stride is the firmware's and may be larger than these 40 bytes.
constexpr uint32_t kDescriptorType = 0;
constexpr uint32_t kDescriptorPhysicalStart = 8;
constexpr uint32_t kDescriptorVirtualStart = 16;
constexpr uint32_t kDescriptorNumberOfPages = 24;
constexpr uint32_t kDescriptorAttribute = 32;
constexpr uint32_t kDescriptorMinimumSize = 40;

constexpr uint32_t kEfiReservedMemoryType = 0;
constexpr uint32_t kEfiLoaderData = 2;
constexpr uint32_t kEfiRuntimeServicesCode = 5;
constexpr uint32_t kEfiRuntimeServicesData = 6;
constexpr uint32_t kEfiConventionalMemory = 7;
constexpr uint32_t kEfiMemoryTypeCount = 16;
constexpr uint64_t kEfiMemoryRuntime = 1ull << 63;

// The 64-bit firmware's system table and runtime services table, read by
// offset from their addresses.
constexpr uint64_t kSystemTableSignature = 0x5453595320494249ull;      // "IBI SYST"
constexpr uint64_t kRuntimeServicesSignature = 0x56524553544e5552ull;  // "RUNTSERV"
constexpr uint32_t kTableRevision = 8;
constexpr uint32_t kTableHeaderSize = 12;
constexpr uint32_t kSystemTableRuntimeServices = 88;
constexpr uint32_t kSystemTableBootServices = 96;
constexpr uint32_t kSystemTableNumberOfTableEntries = 104;
constexpr uint32_t kSystemTableConfigurationTable = 112;
constexpr uint32_t kSystemTableSize = 120;
constexpr uint32_t kRuntimeServicesHeaderSize = 24;

// The ranges that every boot enters in /chosen/memory-map, and the words of
// the failure picture's record.
constexpr uint32_t kBootClutLength = 0x300;
constexpr uint32_t kFailedBootLength = 0x4020;
constexpr uint32_t kFailedBootWidth = 128;
constexpr uint32_t kFailedBootHeight = 128;

}  // namespace nimb::guest
