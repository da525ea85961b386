// The restart probe: restart code for a test image (tools/mkresume). The
// loader enters it as it enters a hibernated system's restart code, with
// EAX at the image's header; the probe checks what it was handed, searches
// memory for the AES key, reports on the serial port in the reference
// kernel's form and powers off.
//
// Where the key may stand: OVMF's variable services (the build without SMM)
// keep two copies of every variable's data in EfiRuntimeServicesData, their
// caches of the variable store, and a deleted variable's bytes stay there.
// The loader moves those regions into the image's runtime area, so after a
// resume the key stands twice in the area and twice where the regions were
// copied from; the store itself lies in flash, outside RAM. Anywhere else it
// is a trace of the loader.
#pragma once

#include <stddef.h>
#include <stdint.h>

#include "entry.h"

namespace nimb::guest {

// What mkresume writes into the probe's data before the probe goes into the
// image: it finds the record by its marker. Little-endian, at fixed offsets.
struct ResumeExpect {
  char marker[8];          // "RPRBEXP1"
  uint32_t keyBytes;       // 0, 16, 24 or 32
  uint8_t keyMasked[32];   // the key, each byte XOR kKeyMask
  uint32_t firstStageSum;  // Adler-32 of the plain first stage behind the header, the restart code left out
  uint32_t finalStep;      // the bar's last step
  uint32_t screenWidth;    // the frame buffer the loader should have described
  uint32_t screenHeight;
  uint32_t screenDepth;
  uint32_t previewDrawn;    // 1: the blurred preview lies under the bar, 0: the logo's grey
  uint32_t descriptorSize;  // the firmware's memory descriptor stride
  uint32_t firstStageBytes;
  uint8_t chainBlock[16];  // the first stage's last 16 bytes as on the disk
  uint8_t saveTable[722];  // the bar's background samples
  uint8_t chainChecked;    // 1: the first stage was encrypted; chainBlock is what the loader keeps
  uint8_t pad;
  uint8_t header[512];  // the header as written
};
static_assert(sizeof(ResumeExpect) == 1328, "the layout that mkresume writes");
static_assert(offsetof(ResumeExpect, firstStageSum) == 44 && offsetof(ResumeExpect, chainBlock) == 76 &&
                  offsetof(ResumeExpect, saveTable) == 92 && offsetof(ResumeExpect, chainChecked) == 814 &&
                  offsetof(ResumeExpect, header) == 816,
              "the offsets that mkresume writes at");

constexpr uint8_t kKeyMask = 0xA5;

// The AES round keys of `key`: for each round both the key expansion's words
// and the equivalent inverse cipher's (the loader's schedule), 16 bytes each,
// leaving out rounds that are the key's own bytes. Returns the count.
uint32_t AesRoundKeys(const uint8_t *key, uint32_t keyBytes, uint8_t (*out)[16]);

// Adler-32 (RFC 1950) continued over `length` bytes.
uint32_t Adler32(uint32_t adler, const uint8_t *bytes, uint32_t length);

// The loader's restoreSum: the Adler-32 of each 4 KiB page by itself,
// summed with wrap-around.
uint32_t Adler32Pages(const uint8_t *code, uint32_t pages);

}  // namespace nimb::guest
