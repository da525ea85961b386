// The console control protocol, which the firmware lacks, over the
// firmware's real console.
//
// The screen is in one of two modes. In text mode it belongs to the text
// console: cleared on entry, cursor shown. In graphics mode it is a surface
// that the loader paints through the graphics output protocol: cleared to
// black on entry, cursor hidden. Text that the loader prints still reaches
// the screen in either mode, wherever the text console puts it. Setting the
// mode that is already set changes nothing on the screen.
#pragma once

#include "efi/efi.h"

namespace nimb::platform {

struct PlatformConsole {
  // First, so that the protocol's `This` is the whole record.
  EFI_CONSOLE_CONTROL_PROTOCOL protocol;
  EFI_CONSOLE_CONTROL_SCREEN_MODE mode;
  EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *text;
  // Null when the firmware has no graphics output.
  EFI_GRAPHICS_OUTPUT_PROTOCOL *graphics;
  // Hears of every call of SetMode with the mode asked for and the status
  // given back; null for none.
  void (*onSetMode)(EFI_CONSOLE_CONTROL_SCREEN_MODE mode, EFI_STATUS status);
};

// Fills in the protocol over `text` and `graphics` and puts the screen into
// `mode`, clearing it even if the mode is already the one set. No one hears
// of SetMode yet.
EFI_STATUS ConsoleControlInit(PlatformConsole *console, EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *text,
                              EFI_GRAPHICS_OUTPUT_PROTOCOL *graphics, EFI_CONSOLE_CONTROL_SCREEN_MODE mode);

// Finds the firmware's console, initialises `console` in `mode` and installs
// its protocol on a new handle.
EFI_STATUS ConsoleControlInstall(PlatformConsole *console, EFI_CONSOLE_CONTROL_SCREEN_MODE mode);

}  // namespace nimb::platform
