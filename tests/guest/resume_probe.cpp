// The restart probe's run: everything the loader hands a restarted image is
// checked against the record that mkresume filled in, then memory is
// searched for the AES key: a round key anywhere fails the run, and each
// place of the key itself is reported ("kernel: resume trace ...") for the
// harness to judge against the firmware's own copies, which the platform
// layer lists before the loader starts. The report uses the reference kernel's lines
// ("kernel: check ...", "kernel: result ...") and its exit codes; lines of
// its own are "kernel: resume <field>=<value> ...".
#include "resume_probe.h"

#include <stddef.h>
#include <stdint.h>

#include "bootargs.h"
#include "checks.h"
#include "entry.h"
#include "exitcodes.h"
#include "memory.h"
#include "report.h"
#include "serial.h"

namespace nimb::guest {

// Filled in by mkresume in the image; all zero but the marker otherwise.
__attribute__((used)) ResumeExpect gResumeExpect = {
    {'R', 'P', 'R', 'B', 'E', 'X', 'P', '1'}, 0, {}, 0, 0, 0, 0, 0, 0, 0, 0, {}, {}, 0, 0, {}};

namespace {

// The header's fields.
constexpr uint32_t kFirstStageBytes = 0x008;
constexpr uint32_t kImageBytes = 0x000;
constexpr uint32_t kRestorePage = 0x010;
constexpr uint32_t kRestorePageCount = 0x014;
constexpr uint32_t kRestoreSum = 0x034;
constexpr uint32_t kRuntimePage = 0x054;
constexpr uint32_t kRuntimePageCount = 0x058;
constexpr uint32_t kVideoDelta = 0x094;
constexpr uint32_t kChainBlockDelta = 0x098;
constexpr uint32_t kMemoryMapDelta = 0x09C;
constexpr uint32_t kMemoryMapBytes = 0x0A0;
constexpr uint32_t kSystemTableOffset = 0x0A4;
constexpr uint32_t kExtentBytes = 0x1DC;
constexpr uint32_t kExtents = 0x1E0;
constexpr uint32_t kHeaderBytes = 512;

// The scratch area in front of the header.
constexpr uint32_t kSaveTableAt = 48;
constexpr uint32_t kChainBlockAt = 772;
constexpr uint32_t kMemoryMapAt = 788;

constexpr uint64_t kMemoryRuntime = 1ull << 63;
constexpr uint32_t kRuntimeCode = 5;
constexpr uint32_t kRuntimeData = 6;

// The bar.
constexpr uint8_t kCellMask[16][7] = {
    {0, 99, 216, 240, 216, 99, 0},       {81, 255, 255, 255, 255, 255, 81},
    {174, 255, 255, 255, 255, 255, 174}, {195, 255, 255, 255, 255, 255, 195},
    {195, 255, 255, 255, 255, 255, 195}, {195, 255, 255, 255, 255, 255, 195},
    {195, 255, 255, 255, 255, 255, 195}, {195, 255, 255, 255, 255, 255, 195},
    {195, 255, 255, 255, 255, 255, 195}, {195, 255, 255, 255, 255, 255, 195},
    {195, 255, 255, 255, 255, 255, 195}, {195, 255, 255, 255, 255, 255, 195},
    {195, 255, 255, 255, 255, 255, 195}, {174, 255, 255, 255, 255, 255, 174},
    {84, 255, 255, 255, 255, 255, 84},   {0, 102, 219, 243, 219, 102, 0},
};
constexpr uint32_t kCells = 19;
constexpr uint32_t kSamplesPerCell = 38;

constexpr uint32_t kMaxPatterns = 32;
constexpr uint32_t kFilterBits = 20;
constexpr uint32_t kMaxHitsShown = 32;

uint32_t gFilter[(1u << kFilterBits) / 32];

inline uint8_t Cmos(uint8_t index) {
  uint8_t value;
  __asm__ volatile("outb %0, $0x70" : : "a"(index));
  __asm__ volatile("inb $0x71, %0" : "=a"(value));
  return value;
}

// QEMU keeps the memory above 16 MiB, in 64 KiB units, in CMOS 0x34/0x35.
uint32_t RamEnd() {
  const uint32_t blocks = static_cast<uint32_t>(Cmos(0x34)) | static_cast<uint32_t>(Cmos(0x35)) << 8;
  return (16u << 20) + (blocks << 16);
}

const uint8_t *At(uint32_t address) {
  return reinterpret_cast<const uint8_t *>(static_cast<uintptr_t>(address));
}

// The first offset at which `a` and `b` differ, or `length`.
uint32_t FirstDifference(const uint8_t *a, const uint8_t *b, uint32_t length) {
  uint32_t i = 0;
  while (i < length && a[i] == b[i]) {
    i++;
  }
  return i;
}

bool InPatchedField(uint32_t offset) {
  return (offset >= kRestoreSum && offset < kRestoreSum + 4) || (offset >= kVideoDelta && offset < 0xA8);
}

struct Handed {
  uint32_t header;
  uint32_t scratch;
  uint32_t firstStage;
  uint32_t codeCopy;  // the restart code as it stands in the first stage
  uint32_t restoreBytes;
  uint32_t runtimeBase;
  uint32_t runtimeEnd;
};

void CheckHeader(const Handed &h, const ResumeExpect &expect) {
  const uint8_t *header = At(h.header);
  uint32_t differences = 0, first = 0;
  for (uint32_t i = 0; i < kHeaderBytes; i++) {
    if (!InPatchedField(i) && header[i] != expect.header[i]) {
      first = differences++ == 0 ? i : first;
    }
  }
  Check("resume-header-preserved", differences == 0, "%u bytes differ, the first at 0x%x", differences,
        first);
  const uint32_t videoDelta = Le32(header + kVideoDelta);
  Check("resume-deltas",
        videoDelta % kPageSize == 0 && videoDelta >= kMemoryMapAt &&
            Le32(header + kChainBlockDelta) == videoDelta - kChainBlockAt &&
            Le32(header + kMemoryMapDelta) == videoDelta - kMemoryMapAt,
        "video=0x%x chainBlock=0x%x memoryMap=0x%x", videoDelta, Le32(header + kChainBlockDelta),
        Le32(header + kMemoryMapDelta));
  const uint32_t sum = Adler32Pages(At(h.codeCopy), Le32(header + kRestorePageCount));
  Check("resume-restore-sum", sum == Le32(header + kRestoreSum), "header 0x%x, recomputed 0x%x",
        Le32(header + kRestoreSum), sum);
}

// Everything of the bar that the loader drew: the save table against the
// model's samples, then each pixel of each cell against the blend of its
// sample with the cell's level (the first drawing shifts by 8, a repaint
// divides by 255).
void CheckBar(const Handed &h, const ResumeExpect &expect) {
  const uint8_t *table = At(h.scratch + kSaveTableAt);
  const uint32_t differ = FirstDifference(table, expect.saveTable, sizeof(expect.saveTable));
  Check("resume-save-table", differ == sizeof(expect.saveTable),
        "%s: first difference at %u: 0x%x, model 0x%x",
        expect.previewDrawn != 0 ? "over the preview" : "over the logo", differ,
        differ < sizeof(expect.saveTable) ? table[differ] : 0,
        differ < sizeof(expect.saveTable) ? expect.saveTable[differ] : 0);

  const uint8_t *video = At(h.scratch);
  const uint32_t base = Le32(video), rowBytes = Le32(video + 16), width = Le32(video + 24);
  const uint32_t height = Le32(video + 32);
  if (base == 0 || Le32(video + 40) != 32) {
    Check("resume-bar", false, "no 32-bit frame buffer to look at");
    return;
  }
  const uint32_t step = expect.finalStep;
  const uint32_t left = (width - 190) / 2, top = height - 97;
  uint32_t wrong = 0, firstCell = 0, firstRow = 0, firstColumn = 0, found = 0, wanted = 0;
  for (uint32_t cell = 0; cell < kCells; cell++) {
    const uint32_t level = cell < step ? 230 : cell == step ? 174 : 92;
    const bool repainted = step > 0 && cell <= step;
    uint32_t sample = 0;
    for (uint32_t row = 0; row < 16; row++) {
      for (uint32_t column = 0; column < 7; column++) {
        const uint32_t alpha = kCellMask[row][column];
        if (alpha == 0) {
          continue;
        }
        uint32_t grey = level;
        if (alpha != 255) {
          const uint32_t background = table[cell * kSamplesPerCell + sample++];
          const uint32_t mix = (255 - alpha) * background + alpha * level + 255;
          grey = repainted ? mix / 255 : mix >> 8;
        }
        const uint32_t pixel =
            Le32(At(base + (top + row) * rowBytes + (left + cell * 10 + column) * 4)) & 0x00FFFFFF;
        const uint32_t model = grey | grey << 8 | grey << 16;
        if (pixel != model && wrong++ == 0) {
          firstCell = cell, firstRow = row, firstColumn = column, found = pixel, wanted = model;
        }
      }
    }
  }
  Check("resume-bar", wrong == 0,
        "step %u: %u pixels differ, the first in cell %u row %u column %u: 0x%x, model 0x%x", step, wrong,
        firstCell, firstRow, firstColumn, found, wanted);
}

void CheckVideo(const Handed &h, const ResumeExpect &expect) {
  const uint8_t *video = At(h.scratch);
  bool upperZero = true;
  for (uint32_t word = 0; word < 6; word++) {
    upperZero = upperZero && Le32(video + word * 8 + 4) == 0;
  }
  Line("resume video base=0x%x mode=%u rowBytes=%u width=%u height=%u depth=%u", Le32(video), Le32(video + 8),
       Le32(video + 16), Le32(video + 24), Le32(video + 32), Le32(video + 40));
  Check("resume-video-record",
        upperZero && Le32(video) != 0 && Le32(video + 8) == 1 && Le32(video + 16) >= expect.screenWidth * 4 &&
            Le32(video + 24) == expect.screenWidth && Le32(video + 32) == expect.screenHeight &&
            Le32(video + 40) == expect.screenDepth,
        "wanted mode 1, %ux%u, depth %u, upper halves zero", expect.screenWidth, expect.screenHeight,
        expect.screenDepth);
}

void CheckRuntime(const Handed &h, const ResumeExpect &expect) {
  const uint8_t *header = At(h.header);
  const uint32_t bytes = Le32(header + kMemoryMapBytes);
  const uint32_t stride = expect.descriptorSize;
  const uint32_t room = Le32(header + kVideoDelta) - kMemoryMapAt;
  bool ok = stride != 0 && bytes % stride == 0 && bytes <= room;
  uint32_t count = ok ? bytes / stride : 0, bad = 0;
  uint64_t next = h.runtimeBase;
  for (uint32_t i = 0; i < count; i++) {
    const uint8_t *d = At(h.scratch + kMemoryMapAt + i * stride);
    const uint32_t type = Le32(d);
    const uint64_t physical = Le64(d + 8), virtualStart = Le64(d + 16), pages = Le64(d + 24);
    const uint64_t attribute = Le64(d + 32);
    Line("resume runtime type=%u physical=0x%llx virtual=0x%llx pages=0x%llx", type,
         static_cast<unsigned long long>(physical), static_cast<unsigned long long>(virtualStart),
         static_cast<unsigned long long>(pages));
    // Runtime code and data were copied into the area; other runtime
    // regions (device memory) only get their virtual addresses behind them.
    const bool copied = type == kRuntimeCode || type == kRuntimeData;
    if ((attribute & kMemoryRuntime) == 0 || virtualStart != next ||
        (copied && (physical != virtualStart ||
                    !Inside(virtualStart, pages * kPageSize, h.runtimeBase, h.runtimeEnd)))) {
      bad++;
    }
    next = virtualStart + pages * kPageSize;
  }
  Check("resume-runtime-map", ok && bad == 0 && count > 0,
        "%u bytes, %u descriptors of %u bytes, %u out of place in [0x%x, 0x%x)", bytes, count, stride, bad,
        h.runtimeBase, h.runtimeEnd);
  const uint32_t offset = Le32(header + kSystemTableOffset);
  Check("resume-system-table-offset", offset != 0 && offset < h.runtimeEnd - h.runtimeBase, "0x%x", offset);
  KernelRegion area = {h.runtimeBase, h.runtimeBase, h.runtimeEnd};
  CheckSystemTableAt(h.runtimeBase + offset, area);
}

void CheckFirstStage(const Handed &h, const ResumeExpect &expect) {
  const uint8_t *chain = At(h.scratch + kChainBlockAt);
  // Without encryption the loader's chain block has no meaning.
  Check("resume-chain-block", expect.chainChecked == 0 || FirstDifference(chain, expect.chainBlock, 16) == 16,
        "0x%x%x..., wanted 0x%x%x...", chain[0], chain[1], expect.chainBlock[0], expect.chainBlock[1]);
  const uint32_t codeAt = h.codeCopy - h.header;
  uint32_t sum = Adler32(1, At(h.header + kHeaderBytes), codeAt - kHeaderBytes);
  sum = Adler32(sum, At(h.codeCopy + h.restoreBytes), h.firstStage - codeAt - h.restoreBytes);
  Check("resume-first-stage", sum == expect.firstStageSum, "Adler-32 0x%x, wanted 0x%x", sum,
        expect.firstStageSum);
}

// --- the search for the key ----------------------------------------------------------

struct Pattern {
  uint8_t bytes[32];
  uint32_t length;
  bool isKey;
};

uint32_t Mix(uint32_t word) {
  return (word * 0x9E3779B1u) >> (32 - kFilterBits);
}

struct Hits {
  uint32_t roundKeys, inArea, copiedFrom, elsewhere, shown;
};

// Whether the page at `address` has its twin in the runtime area: the
// loader copies the firmware's runtime regions there, and both copies
// stay.
bool PageInArea(uint32_t address, const Handed &h) {
  const uint32_t page = address & ~(kPageSize - 1);
  for (uint32_t other = h.runtimeBase; other < h.runtimeEnd; other += kPageSize) {
    if (FirstDifference(At(page), At(other), kPageSize) == kPageSize) {
      return true;
    }
  }
  return false;
}

void NoteHit(const Pattern &pattern, uint32_t address, const Handed &h, Hits *hits) {
  const char *where = "elsewhere";
  if (!pattern.isKey) {
    hits->roundKeys++;
    where = "round key";
  } else if (address >= h.runtimeBase && address < h.runtimeEnd) {
    hits->inArea++;
    where = "runtime area";
  } else if (PageInArea(address, h)) {
    hits->copiedFrom++;
    where = "runtime region copied to the area";
  } else {
    hits->elsewhere++;
  }
  if (hits->shown++ < kMaxHitsShown) {
    Line("resume trace kind=%s address=0x%x where=\"%s\"", pattern.isKey ? "key" : "round-key", address,
         where);
  }
}

void ScanForKey(const Handed &h, const ResumeExpect &expect, uint32_t ownStart, uint32_t ownEnd) {
  if (expect.keyBytes == 0) {
    Line("resume trace none: no key");
    return;
  }
  Pattern patterns[kMaxPatterns];
  uint8_t key[32];
  for (uint32_t i = 0; i < expect.keyBytes; i++) {
    key[i] = expect.keyMasked[i] ^ kKeyMask;
  }
  uint8_t rounds[30][16];
  const uint32_t roundCount = AesRoundKeys(key, expect.keyBytes, rounds);
  uint32_t count = 0;
  for (uint32_t r = 0; r < roundCount && count < kMaxPatterns - 1; r++, count++) {
    for (uint32_t j = 0; j < 16; j++) {
      patterns[count].bytes[j] = rounds[r][j];
    }
    patterns[count].length = 16;
    patterns[count].isKey = false;
  }
  for (uint32_t j = 0; j < expect.keyBytes; j++) {
    patterns[count].bytes[j] = key[j];
  }
  patterns[count].length = expect.keyBytes;
  patterns[count++].isKey = true;
  for (uint32_t p = 0; p < count; p++) {
    for (uint32_t k = 0; k < 4; k++) {
      const uint32_t bit = Mix(Le32(patterns[p].bytes + k));
      gFilter[bit / 32] |= 1u << (bit % 32);
    }
  }

  // Every 4-byte-aligned word of memory, its own pages left out; an
  // occurrence at any byte offset has one aligned word among its first
  // seven bytes.
  const uint32_t end = RamEnd();
  Hits hits = {};
  for (uint32_t address = 0; address + 4 <= end; address += 4) {
    if (address == ownStart) {
      address = ownEnd - 4;
      continue;
    }
    const uint32_t word = *reinterpret_cast<const volatile uint32_t *>(static_cast<uintptr_t>(address));
    const uint32_t bit = Mix(word);
    if ((gFilter[bit / 32] & 1u << (bit % 32)) == 0) {
      continue;
    }
    for (uint32_t p = 0; p < count; p++) {
      for (uint32_t k = 0; k < 4; k++) {
        const uint32_t start = address - k;
        if (Le32(patterns[p].bytes + k) != word || start > address || start + patterns[p].length > end ||
            (start < ownEnd && start + patterns[p].length > ownStart)) {
          continue;
        }
        if (FirstDifference(At(start), patterns[p].bytes, patterns[p].length) == patterns[p].length) {
          NoteHit(patterns[p], start, h, &hits);
        }
      }
    }
  }
  for (uint32_t i = 0; i < sizeof(key); i++) {
    key[i] = 0;
  }
  Line("resume trace roundKeys=%u keyInArea=%u keyCopiedFrom=%u keyElsewhere=%u scanned=0x%x", hits.roundKeys,
       hits.inArea, hits.copiedFrom, hits.elsewhere, end);
  Check("resume-no-round-key", hits.roundKeys == 0, "%u of %u round keys found in memory", hits.roundKeys,
        count - 1);
}

}  // namespace

}  // namespace nimb::guest

extern "C" [[noreturn]] void KernelMain(const nimb::guest::EntryState *state) {
  using namespace nimb::guest;
  SerialInit();
  ReportOutput('\n');
  Line("start");
  CheckEntryState(*state);
  const ResumeExpect &expect = gResumeExpect;
  const uint8_t *header = At(state->eax);
  const bool filled = expect.firstStageBytes != 0;
  Check("resume-record", filled, "the probe's record %s",
        filled ? "filled in" : "empty: not made by mkresume");
  if (filled && Check("resume-header-page", state->eax % kPageSize == 0 && state->eax != 0, "header at 0x%x",
                      state->eax)) {
    Handed h;
    h.header = state->eax;
    h.scratch = h.header - Le32(header + kVideoDelta);
    h.firstStage = static_cast<uint32_t>(Le64(header + kFirstStageBytes));
    h.restoreBytes = Le32(header + kRestorePageCount) * kPageSize;
    h.codeCopy = h.header + kExtents + Le32(header + kExtentBytes);
    h.runtimeBase = Le32(header + kRuntimePage) * kPageSize;
    h.runtimeEnd = h.runtimeBase + Le32(header + kRuntimePageCount) * kPageSize;
    Line("resume header=0x%x scratch=0x%x firstStage=0x%x imageBytes=0x%llx restorePage=0x%x runtime=0x%x",
         h.header, h.scratch, h.firstStage, static_cast<unsigned long long>(Le64(header + kImageBytes)),
         Le32(header + kRestorePage), h.runtimeBase);
    // The other checks walk what the header describes: only a sane
    // layout is walked.
    const uint32_t ram = RamEnd();
    const bool sane = Check(
        "resume-layout",
        h.firstStage == expect.firstStageBytes && h.scratch < h.header &&
            h.codeCopy - h.header >= kHeaderBytes &&
            Inside(h.codeCopy, h.restoreBytes, h.header, h.header + h.firstStage) &&
            Inside(h.header, h.firstStage, 0, ram) && h.runtimeBase < h.runtimeEnd && h.runtimeEnd <= ram,
        "first stage 0x%x (wanted 0x%x) at 0x%x, restart code copy at 0x%x, runtime [0x%x, 0x%x), RAM 0x%x",
        h.firstStage, expect.firstStageBytes, h.header, h.codeCopy, h.runtimeBase, h.runtimeEnd, ram);
    if (sane) {
      CheckHeader(h, expect);
      CheckVideo(h, expect);
      CheckBar(h, expect);
      CheckFirstStage(h, expect);
      CheckRuntime(h, expect);
    }
    if (!sane) {
      h.runtimeBase = h.runtimeEnd = 0;
    }
    const uint32_t ownStart = state->imageStart & ~(kPageSize - 1);
    const uint32_t ownEnd = (state->imageEnd + kPageSize - 1) & ~(kPageSize - 1);
    ScanForKey(h, expect, ownStart, ownEnd);
  }
  PowerOff(ReportResult() ? kExitKernelPass : kExitKernelFail);
}
