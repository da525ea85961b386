#include "screen/spinner.h"

#include "boot/boot.h"
#include "screen/artwork.h"
#include "screen/bootscreen.h"

namespace nimb {

EFI_EVENT gSpinnerEvent;
EFI_UGA_PIXEL *gSpinnerPixels;
UINT64 gSpinnerFrame;

static UINT32 SpinnerX() {
  return (gScreenWidth - kSpinnerSize) >> 1;
}

static UINT32 SpinnerY() {
  return ((gScreenHeight - kSpinnerSize) >> 1) + kSpinnerDrop;
}

static void DrawSpinnerFrame() {
  DrawPixels(gSpinnerPixels + gSpinnerFrame * kSpinnerFramePixels, SpinnerX(), SpinnerY(), kSpinnerSize,
             kSpinnerSize);
}

void StartSpinner() {
  // The whole strip at once, so that a tick is one Blt and no allocation.
  if (EFI_ERROR(
          ExpandIndexedImage(kSpinnerSize, kSpinnerSize * kSpinnerFrames, kSpinnerStrip, &gSpinnerPixels))) {
    return;
  }
  gSpinnerFrame = 0;
  DrawSpinnerFrame();
  if (EFI_ERROR(gBS->CreateEvent(EVT_TIMER | EVT_NOTIFY_SIGNAL, TPL_NOTIFY, SpinnerTick, nullptr,
                                 &gSpinnerEvent))) {
    gSpinnerEvent = nullptr;
    return;
  }
  if (EFI_ERROR(gBS->SetTimer(gSpinnerEvent, TimerPeriodic, kSpinnerPeriod))) {
    gBS->CloseEvent(gSpinnerEvent);
    gSpinnerEvent = nullptr;
  }
}

VOID EFIAPI SpinnerTick(EFI_EVENT, VOID *) {
  gSpinnerFrame++;
  if (gSpinnerFrame > kSpinnerFrames - 1) {
    gSpinnerFrame = 0;
  }
  DrawSpinnerFrame();
}

void StopSpinner() {
  gBS->CloseEvent(gSpinnerEvent);
  gSpinnerEvent = nullptr;
  FillBackground(SpinnerX(), SpinnerY(), kSpinnerSize, kSpinnerSize);
}

}  // namespace nimb
