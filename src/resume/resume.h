// Hibernation resume: a hibernated system asks through NVRAM for its image
// to be restarted; TryResume finds the image, checks it, reads and decrypts
// its first stage, leaves the firmware and enters the image's restart code.
//
// Once `boot-signature` has been seen there is no way back into the normal
// boot: every failure is a cold reset, and as the variable is deleted first,
// the boot after the reset is a normal one.
#pragma once

#include "efi/efi.h"
#include "resume/resume_format.h"

namespace nimb {

// The variables that ask for a restart, under the vendor's variable GUID.
inline constexpr CHAR16 kResumeSignatureVariable[] = u"boot-signature";  // its existence counts
inline constexpr CHAR16 kResumeImageVariable[] = u"boot-image";          // partition and offset
inline constexpr CHAR16 kResumeKeyVariable[] = u"boot-image-key";        // the raw AES key

// Returns only when no restart was asked for, or when the reset that ends a
// failed restart comes back.
void TryResume();

// The memory plan: the header's numbers, checked against every limit before
// any of them is used, and what follows from them. The restart works from
// these, not from the header, which the decryption may rewrite behind the
// header's own 512 bytes only.
struct ResumePlan {
  UINT32 mapCapacity;   // room for the memory map: twice the size first reported
  UINT32 headerOffset;  // of the header in the scratch area, a multiple of 4096
  UINT32 scratchPages;
  UINT32 firstStageBytes;
  UINT64 imageBytes;
  UINT64 restoreBase;  // home of the restart code
  UINT32 restorePageCount;
  UINT32 restoreEntryOffset;
  UINT64 runtimeBase;  // area for the runtime regions
  UINT32 runtimePageCount;
  UINT32 restartCodeOffset;  // of the restart code in the image
  UINT32 previewStageBytes;  // bytes read before the preview is drawn; 0: no preview
  UINT32 previewOffset;      // of the preview section in the image
  UINT32 previewBytes;
  UINT32 previewPictureOffset;
  UINT64 encryptedOffset;
};

// What the three stretches of a resume hand on to each other.
struct ResumeState {
  // Discovery.
  ResumeHeader *poolHeader;  // the header as read, in tracked pool; null once moved
  EFI_DISK_IO_PROTOCOL *diskIo;
  UINT32 mediaId;
  UINT8 *key;           // tracked pool, or null
  UINTN keyBufferSize;  // bytes of `key`'s buffer
  UINTN keyLength;      // the key's length as the variable gave it
  // The read.
  UINT8 *scratch;
  ResumeHeader *header;  // in the scratch area, page-aligned
  ResumePlan plan;
};

// The one way out of a failed resume: once `boot-signature` has been seen,
// wipes the key and resets the machine cold. ExitBoot calls it first, so
// that a Fatal during a resume resets too. Does nothing outside a resume,
// and returns if the reset ever comes back.
void ResumeResetExit();

// The resume under way, from the moment `boot-signature` was seen until
// boot services end (after which failures stop through
// StopAfterBootServices); null outside it.
extern ResumeState *gResumeUnderway;

// Overwrites the key's buffer with zeros (when there is one).
void ResumeWipeKey(ResumeState *state);

}  // namespace nimb
