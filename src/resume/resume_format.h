// The hibernation image as it lies on the disk and as the restart code finds
// it in memory: the 512-byte header, the extent list, and the scratch area
// that the loader lays out for the restart code. The loader reads and patches
// it, and the host tool that writes images builds it, both from these
// definitions. All numbers are little-endian.
//
// The image, counted from the header's first byte:
//
//   0                          the header (its last 32 bytes start the extent list)
//   0x1E0                      the extent list, extentBytes long
//   0x1E0 + extentBytes        the restart code, restorePageCount pages
//   behind it                  the preview section, previewBytes long (may be absent)
//   behind it                  the rest of the first stage, up to firstStageBytes
//   firstStageBytes            the rest of the image, which the loader does not read
//
// The image's bytes are the extents' bytes in list order.
#pragma once

#include <stddef.h>
#include <stdint.h>

namespace nimb {

constexpr uint32_t kResumeMagic = 0x73696D65;  // the bytes 65 6D 69 73 on the disk
constexpr size_t kResumeHeaderBytes = 512;
constexpr size_t kResumeExtentListOffset = 0x1E0;
constexpr size_t kResumePageBytes = 4096;
constexpr size_t kResumeBlockBytes = 16;  // AES-CBC block

// One stretch of the image on the partition.
struct ResumeExtent {
  uint64_t start;   // byte offset on the partition
  uint64_t length;  // bytes
};
static_assert(sizeof(ResumeExtent) == 16, "an extent is 16 bytes");

// The 64-bit fields at 0x6C and 0x74 are only 4-byte aligned.
#pragma pack(push, 4)
struct ResumeHeader {
  uint64_t imageBytes;          // the whole image; sizes the progress bar
  uint64_t firstStageBytes;     // what the loader reads, header included
  uint32_t restorePage;         // home of the restart code, address / 4096
  uint32_t restorePageCount;    // pages of restart code
  uint32_t restoreEntryOffset;  // entry, from the start of the home
  uint8_t reserved1C[24];
  uint32_t restoreSum;  // written by the loader: sum of the page checksums
  uint8_t reserved38[20];
  uint32_t magic;  // kResumeMagic
  uint32_t reserved50;
  uint32_t runtimePage;  // area for the firmware's runtime regions, address / 4096
  uint32_t runtimePageCount;
  uint8_t reserved5C[16];
  uint64_t encryptedOffset;       // where the encrypted part begins; 0: nothing encrypted
  uint64_t machineSignature;      // the FACS hardware signature, zero-extended
  uint32_t previewBytes;          // the preview section; 0: no preview
  uint32_t previewPictureOffset;  // of the picture inside the preview section
  uint8_t reserved84[16];
  uint32_t videoDelta;         // written by the loader: header - ResumeVideoRecord
  uint32_t chainBlockDelta;    // written by the loader: header - ChainBlock
  uint32_t memoryMapDelta;     // written by the loader: header - ResumeMemoryMap
  uint32_t memoryMapBytes;     // written by the loader: runtime descriptors' bytes
  uint32_t systemTableOffset;  // written by the loader: system table - runtime area
  uint8_t reservedA8[308];
  uint32_t extentBytes;     // size of the extent list
  ResumeExtent extents[2];  // the start of the extent list
};
#pragma pack(pop)
static_assert(sizeof(ResumeHeader) == kResumeHeaderBytes, "the header is 512 bytes");
static_assert(offsetof(ResumeHeader, restorePage) == 0x10 && offsetof(ResumeHeader, restoreSum) == 0x34,
              "restart code fields");
static_assert(offsetof(ResumeHeader, magic) == 0x4C && offsetof(ResumeHeader, runtimePage) == 0x54,
              "magic and runtime area");
static_assert(offsetof(ResumeHeader, encryptedOffset) == 0x6C &&
                  offsetof(ResumeHeader, machineSignature) == 0x74,
              "the two 4-byte aligned 64-bit fields");
static_assert(offsetof(ResumeHeader, previewBytes) == 0x7C && offsetof(ResumeHeader, videoDelta) == 0x94,
              "preview and distances");
static_assert(offsetof(ResumeHeader, systemTableOffset) == 0xA4 &&
                  offsetof(ResumeHeader, extentBytes) == 0x1DC,
              "restart record and extent list size");
static_assert(offsetof(ResumeHeader, extents) == kResumeExtentListOffset, "the extent list's start");

// The frame buffer for the restart code: the video fields of the boot
// record, each widened to 64 bits.
struct ResumeVideoRecord {
  uint64_t baseAddress;
  uint64_t displayMode;  // always 1, graphics
  uint64_t rowBytes;
  uint64_t width;
  uint64_t height;
  uint64_t depth;
};
static_assert(sizeof(ResumeVideoRecord) == 48, "six 64-bit words");

// The scratch area: one allocation below 4 GiB, page-aligned. Its front part
// is the same for every image; the header lies on the first page boundary
// behind the memory map, and the first stage follows it.
constexpr size_t kResumeVideoRecordOffset = 0;
constexpr size_t kResumeSaveTableOffset = 48;    // the progress bar's 722 samples
constexpr size_t kResumeChainBlockOffset = 772;  // the last ciphertext block of the first stage
constexpr size_t kResumeMemoryMapOffset = 788;   // the memory map, later the runtime map

// The initialisation vector of the first block, the same for every image.
constexpr uint8_t kResumeIv[kResumeBlockBytes] = {0x5d, 0x2c, 0x81, 0xf0, 0xe4, 0x7a, 0x96, 0xb3,
                                                  0xc6, 0x0d, 0x1f, 0xa8, 0x72, 0x3e, 0x49, 0xb5};

}  // namespace nimb
