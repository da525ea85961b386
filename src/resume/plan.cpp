#include "resume/plan.h"

namespace nimb {

namespace {

// The scratch area's fixed front part and a page less one: the map's room
// rounded up to a page is (mapCapacity + kHeaderRounding) cut to a page.
constexpr UINT64 kHeaderRounding = kResumeMemoryMapOffset + kResumePageBytes - 1;  // 4883
constexpr UINT64 kBelow4G = 0x100000000ull;
constexpr UINT64 kPagesBelow4G = kBelow4G / kResumePageBytes;

UINT64 PageBytes(UINT64 pages) {
  return pages * kResumePageBytes;
}

}  // namespace

UINT32 ResumeHeaderOffset(UINT32 mapCapacity) {
  return static_cast<UINT32>((mapCapacity + kHeaderRounding) & ~static_cast<UINT64>(kResumePageBytes - 1));
}

BOOLEAN ResumePlanImage(const ResumeHeader *header, UINT64 mapSize, ResumePlan *plan) {
  const UINT64 firstStage = header->firstStageBytes;
  if (firstStage < kResumeHeaderBytes || firstStage >= kBelow4G || header->imageBytes < firstStage) {
    return FALSE;
  }
  // Both areas lie wholly below 4 GiB: the restart code's home is written
  // and entered through 32-bit addresses, and so is the runtime area known.
  if (static_cast<UINT64>(header->restorePage) + header->restorePageCount > kPagesBelow4G ||
      static_cast<UINT64>(header->runtimePage) + header->runtimePageCount > kPagesBelow4G) {
    return FALSE;
  }
  // The extent list holds at least the first extent; it, the restart code
  // and the preview section lie inside the first stage.
  if (header->extentBytes < sizeof(ResumeExtent)) {
    return FALSE;
  }
  const UINT64 codeOffset = kResumeExtentListOffset + static_cast<UINT64>(header->extentBytes);
  const UINT64 previewOffset = codeOffset + PageBytes(header->restorePageCount);
  if (previewOffset > firstStage) {
    return FALSE;
  }
  UINT64 previewStage = 0;
  if (header->previewBytes != 0) {
    const UINT64 previewEnd = previewOffset + header->previewBytes;
    if (previewEnd <= kResumeHeaderBytes || previewEnd > firstStage) {
      return FALSE;
    }
    previewStage = previewEnd - kResumeHeaderBytes;
  }
  // The encrypted part is whole blocks up to the end of the first stage and
  // leaves the header and the extent list plain: both are used before
  // anything is decrypted, and the header goes back to the restart code
  // patched.
  const UINT64 encrypted = header->encryptedOffset;
  const UINT64 plainBytes = codeOffset > kResumeHeaderBytes ? codeOffset : kResumeHeaderBytes;
  if (encrypted != 0 && (encrypted < plainBytes || encrypted >= firstStage ||
                         (firstStage - encrypted) % kResumeBlockBytes != 0)) {
    return FALSE;
  }
  // The scratch area, map and first stage together, stays below 4 GiB.
  if (mapSize > (kBelow4G - kHeaderRounding) / 2) {
    return FALSE;
  }
  const UINT32 mapCapacity = static_cast<UINT32>(2 * mapSize);
  const UINT64 headerOffset = ResumeHeaderOffset(mapCapacity);
  if (headerOffset + firstStage + kResumePageBytes > kBelow4G) {
    return FALSE;
  }
  plan->mapCapacity = mapCapacity;
  plan->headerOffset = static_cast<UINT32>(headerOffset);
  plan->scratchPages = static_cast<UINT32>(((headerOffset + firstStage) / kResumePageBytes) + 1);
  plan->firstStageBytes = static_cast<UINT32>(firstStage);
  plan->imageBytes = header->imageBytes;
  plan->restoreBase = PageBytes(header->restorePage);
  plan->restorePageCount = header->restorePageCount;
  plan->restoreEntryOffset = header->restoreEntryOffset;
  plan->runtimeBase = PageBytes(header->runtimePage);
  plan->runtimePageCount = header->runtimePageCount;
  plan->restartCodeOffset = static_cast<UINT32>(codeOffset);
  plan->previewStageBytes = static_cast<UINT32>(previewStage);
  plan->previewOffset = static_cast<UINT32>(previewOffset);
  plan->previewBytes = header->previewBytes;
  plan->previewPictureOffset = header->previewPictureOffset;
  plan->encryptedOffset = encrypted;
  return TRUE;
}

}  // namespace nimb
