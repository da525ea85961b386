// The end of a run without the debug-exit device: the outcome on the
// firmware's text console, a key to wait for, and the firmware left as it
// was found before the platform goes back to it.
#pragma once

#include "efi/efi.h"

namespace nimb::platform {

// Writes `text` (ASCII) and a new line on the firmware's text console
// (gST->ConOut); nothing without one.
void ShowOnScreen(const char *text);

// Shows `prompt` on the screen and waits for a key on the firmware's
// keyboard (gST->ConIn), keys pressed before the prompt left aside. False at
// once, without the prompt, when there is no keyboard.
bool WaitForKeyPress(const char *prompt);

// Removes every protocol interface that lies in the platform's own image,
// which the firmware frees when the platform returns; returns their count.
// The wrappers over the firmware's own interfaces must be undone first.
UINTN UninstallOwnInterfaces();

}  // namespace nimb::platform
