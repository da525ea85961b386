#include "screen/bootscreen.h"

#include "boot/boot.h"
#include "boot/bootinfo.h"
#include "config/boot_options.h"
#include "efi/vendor.h"
#include "memory/kernel_region.h"
#include "memory/tracking.h"
#include "screen/artwork.h"
#include "screen/console.h"
#include "screen/spinner.h"
#include "support/strings.h"

namespace nimb {

EFI_UGA_DRAW_PROTOCOL *gUgaDraw;
UINT32 gScreenWidth;
UINT32 gScreenHeight;
UINT32 gScreenDepth;
UINT64 gFrameBufferBase;
UINT32 gFrameBufferRowBytes;

// What the kernel finds at "Pict-FailedBoot": width, height, then zeros up to
// the failure picture's indexes, so that every boot hands the same record.
constexpr UINT64 kFailedBootPixelsOffset = 32;
constexpr UINT64 kFailedBootRecordSize = kFailedBootPixelsOffset + kPictureBytes;
static_assert(kFailedBootRecordSize == 16416);

EFI_STATUS EnterGraphics() {
  EFI_STATUS status = SetConsoleMode(kConsoleGraphics);
  if (EFI_ERROR(status)) {
    return status;
  }
  status = gBS->HandleProtocol(gST->ConsoleOutHandle, &gEfiUgaDrawProtocolGuid,
                               reinterpret_cast<void **>(&gUgaDraw));
  if (EFI_ERROR(status)) {
    return status;
  }
  if (gUgaDraw == nullptr) {
    return EFI_NOT_FOUND;
  }
  gBootFlags |= kBootGraphics;
  UINT32 refresh = 0;  // asked for, not used
  return gUgaDraw->GetMode(gUgaDraw, &gScreenWidth, &gScreenHeight, &gScreenDepth, &refresh);
}

void FillBackground(UINT32 x, UINT32 y, UINT32 width, UINT32 height) {
  EFI_UGA_PIXEL grey = {191, 191, 191, 0};
  gUgaDraw->Blt(gUgaDraw, &grey, EfiUgaVideoFill, 0, 0, x, y, width, height, 0);
}

void DrawPixels(EFI_UGA_PIXEL *pixels, UINT32 x, UINT32 y, UINT32 width, UINT32 height) {
  gUgaDraw->Blt(gUgaDraw, pixels, EfiUgaBltBufferToVideo, 0, 0, x, y, width, height, 0);
}

EFI_STATUS ExpandIndexedImage(UINT32 width, UINT32 height, const UINT8 *indexes, EFI_UGA_PIXEL **pixels) {
  const UINTN count = static_cast<UINTN>(width) * height;
  EFI_UGA_PIXEL *buffer = static_cast<EFI_UGA_PIXEL *>(TrackedAllocatePool(count * sizeof(EFI_UGA_PIXEL)));
  if (buffer == nullptr) {
    return EFI_OUT_OF_RESOURCES;
  }
  for (UINTN i = 0; i < count; i++) {
    const UINT8 *entry = &kBootColorTable[3 * indexes[i]];
    buffer[i].Blue = entry[2];
    buffer[i].Green = entry[1];
    buffer[i].Red = entry[0];
    buffer[i].Reserved = 0;  // the same pixels on every boot, whatever the pool held
  }
  *pixels = buffer;
  return EFI_SUCCESS;
}

// A 128 x 128 picture in the middle of the screen. Its pixels live only for
// the Blt.
static void DrawCentredPicture(const UINT8 *indexes) {
  EFI_UGA_PIXEL *pixels = nullptr;
  if (EFI_ERROR(ExpandIndexedImage(kPictureSize, kPictureSize, indexes, &pixels))) {
    return;
  }
  DrawPixels(pixels, (gScreenWidth - kPictureSize) >> 1, (gScreenHeight - kPictureSize) >> 1, kPictureSize,
             kPictureSize);
  TrackedFree(pixels);
}

void DrawBootScreen() {
  if (EFI_ERROR(EnterGraphics())) {
    return;
  }
  FillBackground(0, 0, gScreenWidth, gScreenHeight);

  // Without pool for the logo's indexes the screen stays plain grey.
  UINT8 *indexes = static_cast<UINT8 *>(TrackedAllocatePool(kPictureBytes));
  if (indexes != nullptr) {
    UINTN filled = 0;
    for (UINTN pair = 0; pair < kLogoPairs; pair++) {
      UINTN count = kLogoRuns[2 * pair];
      if (count > kPictureBytes - filled) {
        count = kPictureBytes - filled;
      }
      memset(indexes + filled, kLogoRuns[2 * pair + 1], count);
      filled += count;
    }
    DrawCentredPicture(indexes);
    TrackedFree(indexes);
  }

  // Only a network boot has a spinner.
  if ((gBootFlags & kBootNetwork) != 0) {
    StartSpinner();
  }
}

void ShowBootScreen() {
  if (!EFI_ERROR(EnterGraphics())) {
    DrawBootScreen();
  }
}

void DrawFailureScreen() {
  if (gConsoleMode != EfiConsoleControlScreenGraphics || gUgaDraw == nullptr) {
    return;
  }
  FillBackground(0, 0, gScreenWidth, gScreenHeight);
  DrawCentredPicture(kFailurePicture);
}

void GetFrameBufferInfo(VideoInfo *record) {
  if (gFrameBufferBase == 0) {
    NIMB_FRAME_BUFFER_INFO_PROTOCOL *info = nullptr;
    EFI_STATUS status =
        gBS->LocateProtocol(&gNimbFrameBufferInfoProtocolGuid, nullptr, reinterpret_cast<void **>(&info));
    if (EFI_ERROR(status) || info == nullptr) {
      return;
    }
    UINT32 size = 0;  // asked for, not used
    status = info->GetInfo(info, &gFrameBufferBase, &size, &gFrameBufferRowBytes, &gScreenWidth,
                           &gScreenHeight, &gScreenDepth);
    if (EFI_ERROR(status)) {
      gFrameBufferBase = 0;
      return;
    }
  }
  if (record != nullptr) {
    record->baseAddress = static_cast<UINT32>(gFrameBufferBase);
    record->rowBytes = gFrameBufferRowBytes;
    record->width = gScreenWidth;
    record->height = gScreenHeight;
    record->depth = gScreenDepth;
  }
}

void FillVideoInfo(BootArgs *bootArgs) {
  VideoInfo video = {};
  GetFrameBufferInfo(&video);
  if (video.baseAddress == 0) {
    video.rowBytes = 0;
    video.width = 0;
    video.height = 0;
    video.depth = 0;
  }
  video.displayMode = (gBootFlags & kBootGraphics) != 0 ? kVideoGraphics : kVideoText;
  bootArgs->videoBaseAddress = video.baseAddress;
  bootArgs->videoDisplayMode = video.displayMode;
  bootArgs->videoRowBytes = video.rowBytes;
  bootArgs->videoWidth = video.width;
  bootArgs->videoHeight = video.height;
  bootArgs->videoDepth = video.depth;

  UINT64 size = kColorTableSize;
  UINT64 address = AllocateKernelRegion(&size);
  if (address == 0) {
    Fatal("Could not allocate CLUT");
  }
  AddMemoryRange("BootCLUT", address, kColorTableSize, 0);
  memcpy(reinterpret_cast<void *>(address), kBootColorTable, kColorTableSize);

  size = kFailedBootRecordSize;
  address = AllocateKernelRegion(&size);
  if (address == 0) {
    Fatal("Could not allocate Pict-FailedBoot");
  }
  AddMemoryRange("Pict-FailedBoot", address, kFailedBootRecordSize, 0);
  UINT32 *header = reinterpret_cast<UINT32 *>(address);
  bzero(header, kFailedBootPixelsOffset);
  header[0] = kPictureSize;
  header[1] = kPictureSize;
  memcpy(reinterpret_cast<UINT8 *>(address) + kFailedBootPixelsOffset, kFailurePicture, kPictureBytes);
}

}  // namespace nimb
