// The boot record handed to the kernel, and the first part of the device
// tree that depends on the boot volume and the options.
#pragma once

#include "efi/efi.h"

namespace nimb {

// The record the kernel finds at the address in EAX. Addresses are the low
// 32 bits of the loader's; all numbers little-endian.
struct BootArgs {
  UINT16 revision;  // 4
  UINT16 version;   // 1
  char commandLine[1024];
  UINT32 memoryMap;
  UINT32 memoryMapSize;
  UINT32 memoryDescriptorSize;
  UINT32 memoryDescriptorVersion;
  UINT32 videoBaseAddress;
  UINT32 videoDisplayMode;
  UINT32 videoRowBytes;
  UINT32 videoWidth;
  UINT32 videoHeight;
  UINT32 videoDepth;
  UINT32 deviceTree;
  UINT32 deviceTreeLength;
  UINT32 kernelRegionBase;
  UINT32 kernelRegionSize;
  UINT32 runtimePageStart;
  UINT32 runtimePageCount;
  UINT32 systemTable;
  UINT8 firmwareBits;  // 0x40
  UINT8 reserved[31];
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

constexpr UINT16 kBootArgsRevision = 4;
constexpr UINT16 kBootArgsVersion = 1;
constexpr UINT8 kFirmwareBits = 0x40;

extern BootArgs *bootArgs;

// Allocates the record at the top of the kernel region and adds the first
// properties of /, /chosen and /chosen/memory-map. Always 0.
EFI_STATUS InitBootInfo(EFI_LOADED_IMAGE_PROTOCOL *loadedImage, const char *options);

}  // namespace nimb
