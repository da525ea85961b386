// The console control protocol, which the firmware lacks, over the
// firmware's real console.
//
// The screen is in one of two modes. In text mode it belongs to the text
// console: cleared on entry, cursor shown. In graphics mode it is a surface
// that the loader paints through the graphics output protocol: cleared to
// black on entry, cursor hidden. Text that the loader prints goes through
// `screenText`, which the system table offers while the loader runs: in text
// mode it reaches the firmware's text console, in graphics mode it stays off
// the screen, as on the vendor's machines, and goes to `hiddenText` instead
// (the serial port). Setting the mode that is already set changes nothing on
// the screen.
#pragma once

#include "efi/efi.h"
#include "firmware.h"

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
  // The text console as the loader sees it (see above); the same mode record
  // as the firmware's.
  EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL screenText;
  // Receives the text kept off the screen in graphics mode; null drops it.
  void (*hiddenText)(const CHAR16 *text);
};

// Fills in the protocol over `text` and `graphics` and puts the screen into
// `mode`, clearing it even if the mode is already the one set; text instead
// of graphics when there is no graphics output. No one hears of SetMode yet.
EFI_STATUS ConsoleControlInit(PlatformConsole *console, EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *text,
                              EFI_GRAPHICS_OUTPUT_PROTOCOL *graphics, EFI_CONSOLE_CONTROL_SCREEN_MODE mode);

// Makes the system table offer `screenText` as its ConOut (`on`), or the
// firmware's own again.
void ConsoleOfferScreenText(PlatformConsole *console, bool on);

// Finds the firmware's console, initialises `console` in `mode` and puts
// its protocol into `slot`.
EFI_STATUS ConsoleControlInstall(PlatformConsole *console, EFI_CONSOLE_CONTROL_SCREEN_MODE mode,
                                 ProtocolSlot slot);

}  // namespace nimb::platform
