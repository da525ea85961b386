#include "resume/image_read.h"

#include "boot/boot.h"
#include "memory/tracking.h"
#include "resume/aes.h"
#include "resume/plan.h"
#include "screen/console.h"
#include "screen/resume_display.h"
#include "support/strings.h"

namespace nimb {

namespace {

// Frames that the decryption left below the caller's are overwritten with
// this much of zeros: the expanded key and its pieces must not stay behind.
constexpr UINTN kStackScrubBytes = 4096;

// The largest read in the main stage: one step of the bar at most. A total
// whose nineteenth does not fit 32 bits reads in the largest pieces.
UINT32 ChunkLimit(UINT64 progressTotal) {
  const UINT64 limit = progressTotal / kProgressCells;
  return limit > 0xFFFFFFFFull ? 0xFFFFFFFFu : static_cast<UINT32>(limit);
}

// Pages at a fixed address; none asked for is no failure.
bool ReserveAt(UINT64 base, UINT32 pages) {
  if (pages == 0) {
    return true;
  }
  EFI_PHYSICAL_ADDRESS address = base;
  return !EFI_ERROR(TrackedAllocatePages(AllocateAddress, EfiLoaderData, pages, &address)) && address == base;
}

// The walk over the extents, in two stages when there is a preview: the
// first ends with the preview section, which is then drawn; the second reads
// the rest of the first stage in pieces of one step of the bar. An entry of
// the extent list is used only when it lies inside the list and its bytes
// have been read.
bool ReadFirstStage(ResumeState *state) {
  const ResumePlan &plan = state->plan;
  UINT8 *const header = reinterpret_cast<UINT8 *>(state->header);
  UINT8 *const saveTable = state->scratch + kResumeSaveTableOffset;
  const ResumeExtent *const list = state->header->extents;
  const UINT32 listEntries = state->header->extentBytes / sizeof(ResumeExtent);

  UINT32 entry = 0;
  if (list[0].length < kResumeHeaderBytes) {
    return false;
  }
  UINT64 extentLeft = list[0].length - kResumeHeaderBytes;
  UINT64 diskPosition = list[0].start + kResumeHeaderBytes;
  UINT8 *destination = header + kResumeHeaderBytes;
  UINT32 remaining = plan.firstStageBytes - kResumeHeaderBytes;

  bool inPreviewStage = plan.previewStageBytes != 0;
  UINT32 mainStageBytes = 0;
  UINT64 progressTotal = plan.imageBytes;
  UINT32 chunkLimit = 0;
  if (inPreviewStage) {
    mainStageBytes = remaining - plan.previewStageBytes;
    remaining = plan.previewStageBytes;
    progressTotal = plan.imageBytes - plan.previewStageBytes;
  } else {
    chunkLimit = ChunkLimit(progressTotal);
    DrawResumeScreen(nullptr, nullptr, saveTable);
  }
  UINT64 bytesDone = 0;
  UINT32 progressStep = 0;

  while (remaining != 0) {
    if (extentLeft == 0) {
      entry++;
      const UINT64 entryEnd =
          kResumeExtentListOffset + (static_cast<UINT64>(entry) + 1) * sizeof(ResumeExtent);
      if (entry >= listEntries || entryEnd > static_cast<UINT64>(destination - header)) {
        return false;
      }
      diskPosition = list[entry].start;
      extentLeft = list[entry].length;
      continue;
    }
    UINT32 n = extentLeft < remaining ? static_cast<UINT32>(extentLeft) : remaining;
    if (chunkLimit != 0 && n > chunkLimit) {
      n = chunkLimit;
    }
    if (EFI_ERROR(state->diskIo->ReadDisk(state->diskIo, state->mediaId, diskPosition, n, destination))) {
      printf("!Read %x\n", static_cast<UINT64>(n));
      return false;
    }
    remaining -= n;
    if (inPreviewStage && remaining == 0) {
      // The preview section is in memory: its picture, when it starts inside
      // the section, is drawn; the section's end bounds the drawing's reads.
      const UINT8 *section = header + plan.previewOffset;
      const UINT8 *picture =
          plan.previewPictureOffset < plan.previewBytes ? section + plan.previewPictureOffset : nullptr;
      DrawResumeScreen(picture, section + plan.previewBytes, saveTable);
      inPreviewStage = false;
      remaining = mainStageBytes;
      chunkLimit = ChunkLimit(progressTotal);
    } else if (!inPreviewStage) {
      bytesDone += n;
      const UINT32 step = static_cast<UINT32>(bytesDone * kProgressCells / progressTotal);
      if (step != progressStep) {
        DrawResumeProgress(saveTable, static_cast<INT32>(progressStep), static_cast<INT32>(step));
        progressStep = step;
      }
    }
    diskPosition += n;
    extentLeft -= n;
    destination += n;
  }
  return true;
}

// An encrypted image needs a key whose length selects a schedule.
bool KeySelectsSchedule(const ResumeState *state) {
  return state->key != nullptr && state->keyLength <= 0x7FFFFFFF &&
         AesRoundsForKeyLength(static_cast<INT32>(state->keyLength)) != 0;
}

// Decrypts the first stage from `encryptedOffset` on, in place, and keeps
// its last ciphertext block in `lastBlock`. False when the key is missing or
// its length selects no schedule. The schedule is wiped before the return.
__attribute__((noinline)) bool DecryptInPlace(ResumeState *state, UINT8 *lastBlock) {
  const ResumePlan &plan = state->plan;
  if (!KeySelectsSchedule(state)) {
    return false;
  }
  AesDecryptContext context;
  context.rounds = 0;  // an unknown length leaves it so
  AesExpandDecryptKey(state->key, static_cast<INT32>(state->keyLength), &context);
  const bool scheduled = context.rounds != 0;
  if (scheduled) {
    UINT8 *header = reinterpret_cast<UINT8 *>(state->header);
    bcopy(header + plan.firstStageBytes - kResumeBlockBytes, lastBlock, kResumeBlockBytes);
    const UINT32 blocks =
        static_cast<UINT32>((plan.firstStageBytes - plan.encryptedOffset) / kResumeBlockBytes);
    AesCbcDecrypt(header + plan.encryptedOffset, kResumeIv, blocks, header + plan.encryptedOffset, &context);
  }
  AesWipe(&context);
  return scheduled;
}

// Overwrites the stack below the caller's frame, where the decryption's
// frames were.
__attribute__((noinline)) void ScrubStack() {
  volatile UINT8 area[kStackScrubBytes];
  for (UINTN i = 0; i < kStackScrubBytes; i++) {
    area[i] = 0;
  }
}

// The decryption, ChainBlock, and the key wiped whatever happened.
bool DecryptFirstStage(ResumeState *state) {
  UINT8 lastBlock[kResumeBlockBytes] = {};
  const bool decrypted = state->plan.encryptedOffset == 0 || DecryptInPlace(state, lastBlock);
  ScrubStack();
  bcopy(lastBlock, state->scratch + kResumeChainBlockOffset, kResumeBlockBytes);
  bzero(lastBlock, kResumeBlockBytes);
  ResumeWipeKey(state);
  return decrypted;
}

}  // namespace

BOOLEAN ResumeReadImage(ResumeState *state) {
  ResumePlan &plan = state->plan;
  UINTN mapSize = 0;
  UINTN mapKey = 0;
  UINTN descriptorSize = 0;
  UINT32 descriptorVersion = 0;
  if (gBS->GetMemoryMap(&mapSize, nullptr, &mapKey, &descriptorSize, &descriptorVersion) !=
          EFI_BUFFER_TOO_SMALL ||
      !ResumePlanImage(state->poolHeader, mapSize, &plan)) {
    return FALSE;
  }
  // The two fixed places first, then the scratch area below 4 GiB.
  EFI_PHYSICAL_ADDRESS scratch = 0xFFFFFFFF;
  if (!ReserveAt(plan.restoreBase, plan.restorePageCount) ||
      !ReserveAt(plan.runtimeBase, plan.runtimePageCount) ||
      EFI_ERROR(TrackedAllocatePages(AllocateMaxAddress, EfiLoaderData, plan.scratchPages, &scratch))) {
    return FALSE;
  }
  state->scratch = reinterpret_cast<UINT8 *>(scratch);
  state->header = reinterpret_cast<ResumeHeader *>(state->scratch + plan.headerOffset);
  memcpy(state->header, state->poolHeader, sizeof(ResumeHeader));
  TrackedFree(state->poolHeader);
  state->poolHeader = nullptr;

  // Distances back from the header to what the restart code finds.
  state->header->videoDelta = plan.headerOffset - kResumeVideoRecordOffset;
  state->header->chainBlockDelta = plan.headerOffset - kResumeChainBlockOffset;
  state->header->memoryMapDelta = plan.headerOffset - kResumeMemoryMapOffset;

  // A key that cannot decrypt is known before anything is read. After a
  // failed read the key is wiped by the reset's way out.
  if (plan.encryptedOffset != 0 && !KeySelectsSchedule(state)) {
    return FALSE;
  }
  return ReadFirstStage(state) && DecryptFirstStage(state);
}

}  // namespace nimb
