// The spinner of a network boot: 18 frames turning below the logo, one step
// every 100 ms, driven by a firmware timer at TPL_NOTIFY. The tick touches
// only its frame counter and its own 32 x 32 rectangle of the screen.
#pragma once

#include "efi/efi.h"

namespace nimb {

// Timer event of the spinner; null when no spinner runs.
extern EFI_EVENT gSpinnerEvent;
// All frames, expanded once before the timer starts, one under the other.
extern EFI_UGA_PIXEL *gSpinnerPixels;
// The frame on the screen, 0 to 17.
extern UINT64 gSpinnerFrame;

// The spinner's place: 200 pixels below where a centred frame would stand.
constexpr UINT32 kSpinnerDrop = 200;
// The timer's period in units of 100 ns.
constexpr UINT64 kSpinnerPeriod = 1000000;

// Expands the frames, draws frame 0 and starts the timer. Without pixels
// nothing is drawn; without a timer frame 0 stays on the screen.
void StartSpinner();
// The timer's notify function: the next frame. Its arguments are not read.
VOID EFIAPI SpinnerTick(EFI_EVENT event, VOID *context);
// Closes the timer and paints the spinner's rectangle grey. The frames stay
// allocated.
void StopSpinner();

}  // namespace nimb
