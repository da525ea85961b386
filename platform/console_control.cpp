#include "console_control.h"

#include "firmware.h"

namespace nimb::platform {

namespace {

PlatformConsole *ConsoleOf(EFI_CONSOLE_CONTROL_PROTOCOL *protocol) {
  return reinterpret_cast<PlatformConsole *>(protocol);
}

EFI_STATUS EnterText(PlatformConsole *console) {
  if (console->text == nullptr) {
    return EFI_UNSUPPORTED;
  }
  const EFI_STATUS status = console->text->ClearScreen(console->text);
  if (EFI_ERROR(status)) {
    return status;
  }
  console->text->EnableCursor(console->text, TRUE);
  return EFI_SUCCESS;
}

EFI_STATUS EnterGraphics(PlatformConsole *console) {
  if (console->graphics == nullptr) {
    return EFI_UNSUPPORTED;
  }
  if (console->text != nullptr) {
    console->text->EnableCursor(console->text, FALSE);
  }
  const EFI_GRAPHICS_OUTPUT_MODE_INFORMATION *info = console->graphics->Mode->Info;
  EFI_GRAPHICS_OUTPUT_BLT_PIXEL black = {0, 0, 0, 0};
  return console->graphics->Blt(console->graphics, &black, EfiBltVideoFill, 0, 0, 0, 0,
                                info->HorizontalResolution, info->VerticalResolution, 0);
}

EFI_STATUS Enter(PlatformConsole *console, EFI_CONSOLE_CONTROL_SCREEN_MODE mode) {
  EFI_STATUS status;
  switch (mode) {
    case EfiConsoleControlScreenText:
      status = EnterText(console);
      break;
    case EfiConsoleControlScreenGraphics:
      status = EnterGraphics(console);
      break;
    default:
      return EFI_INVALID_PARAMETER;
  }
  if (!EFI_ERROR(status)) {
    console->mode = mode;
  }
  return status;
}

EFI_STATUS EFIAPI GetMode(EFI_CONSOLE_CONTROL_PROTOCOL *This, EFI_CONSOLE_CONTROL_SCREEN_MODE *Mode,
                          BOOLEAN *UgaExists, BOOLEAN *StdInLocked) {
  if (This == nullptr || Mode == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  PlatformConsole *console = ConsoleOf(This);
  *Mode = console->mode;
  if (UgaExists != nullptr) {
    *UgaExists = console->graphics != nullptr ? TRUE : FALSE;
  }
  if (StdInLocked != nullptr) {
    *StdInLocked = FALSE;
  }
  return EFI_SUCCESS;
}

EFI_STATUS ChangeMode(PlatformConsole *console, EFI_CONSOLE_CONTROL_SCREEN_MODE mode) {
  if (mode >= EfiConsoleControlScreenMaxValue) {
    return EFI_INVALID_PARAMETER;
  }
  if (mode == console->mode) {
    return EFI_SUCCESS;
  }
  return Enter(console, mode);
}

EFI_STATUS EFIAPI SetMode(EFI_CONSOLE_CONTROL_PROTOCOL *This, EFI_CONSOLE_CONTROL_SCREEN_MODE Mode) {
  if (This == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  PlatformConsole *console = ConsoleOf(This);
  const EFI_STATUS status = ChangeMode(console, Mode);
  if (console->onSetMode != nullptr) {
    console->onSetMode(Mode, status);
  }
  return status;
}

EFI_STATUS EFIAPI LockStdIn(EFI_CONSOLE_CONTROL_PROTOCOL *, CHAR16 *) {
  return EFI_UNSUPPORTED;
}

// The text console the loader sees: each call goes to the firmware's, with
// the firmware's own `This`, except text in graphics mode.
PlatformConsole *ConsoleOfText(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *text) {
  return reinterpret_cast<PlatformConsole *>(reinterpret_cast<UINT8 *>(text) -
                                             offsetof(PlatformConsole, screenText));
}

EFI_STATUS EFIAPI TextOutputString(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This, const CHAR16 *String) {
  PlatformConsole *console = ConsoleOfText(This);
  if (console->mode == EfiConsoleControlScreenGraphics) {
    if (console->hiddenText != nullptr && String != nullptr) {
      console->hiddenText(String);
    }
    return EFI_SUCCESS;
  }
  return console->text->OutputString(console->text, String);
}

EFI_STATUS EFIAPI TextReset(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This, BOOLEAN Extended) {
  EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *text = ConsoleOfText(This)->text;
  return text->Reset(text, Extended);
}

EFI_STATUS EFIAPI TextSetAttribute(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This, UINTN Attribute) {
  EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *text = ConsoleOfText(This)->text;
  return text->SetAttribute(text, Attribute);
}

EFI_STATUS EFIAPI TextClearScreen(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This) {
  EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *text = ConsoleOfText(This)->text;
  return text->ClearScreen(text);
}

EFI_STATUS EFIAPI TextEnableCursor(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This, BOOLEAN Visible) {
  EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *text = ConsoleOfText(This)->text;
  return text->EnableCursor(text, Visible);
}

// The slots the loader never calls are refused rather than handed the wrong
// `This`.
EFI_STATUS EFIAPI TextUnsupported() {
  return EFI_UNSUPPORTED;
}

void InitScreenText(PlatformConsole *console) {
  EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL &screen = console->screenText;
  screen = {};
  if (console->text == nullptr) {
    return;
  }
  screen.Reset = TextReset;
  screen.OutputString = TextOutputString;
  screen.TestString = reinterpret_cast<void *>(TextUnsupported);
  screen.QueryMode = reinterpret_cast<void *>(TextUnsupported);
  screen.SetMode = reinterpret_cast<void *>(TextUnsupported);
  screen.SetAttribute = TextSetAttribute;
  screen.ClearScreen = TextClearScreen;
  screen.SetCursorPosition = reinterpret_cast<void *>(TextUnsupported);
  screen.EnableCursor = TextEnableCursor;
  screen.Mode = console->text->Mode;
}

}  // namespace

EFI_STATUS ConsoleControlInit(PlatformConsole *console, EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *text,
                              EFI_GRAPHICS_OUTPUT_PROTOCOL *graphics, EFI_CONSOLE_CONTROL_SCREEN_MODE mode) {
  console->protocol.GetMode = GetMode;
  console->protocol.SetMode = SetMode;
  console->protocol.LockStdIn = LockStdIn;
  console->mode = EfiConsoleControlScreenText;
  console->text = text;
  console->graphics = graphics;
  console->onSetMode = nullptr;
  console->hiddenText = nullptr;
  InitScreenText(console);
  // Without graphics output the screen can only be text: the loader then
  // finds text and boots in text.
  if (graphics == nullptr && mode == EfiConsoleControlScreenGraphics) {
    mode = EfiConsoleControlScreenText;
  }
  return Enter(console, mode);
}

void ConsoleOfferScreenText(PlatformConsole *console, bool on) {
  if (console->text == nullptr) {
    return;
  }
  gST->ConOut = on ? &console->screenText : console->text;
  typedef EFI_STATUS(EFIAPI * Crc32Function)(const VOID *Data, UINTN DataSize, UINT32 *Crc32);
  Crc32Function crc32 = reinterpret_cast<Crc32Function>(gBS->CalculateCrc32);
  UINT32 crc = 0;
  gST->Hdr.CRC32 = 0;
  if (crc32 != nullptr && !EFI_ERROR(crc32(gST, gST->Hdr.HeaderSize, &crc))) {
    gST->Hdr.CRC32 = crc;
  }
}

EFI_STATUS ConsoleControlInstall(PlatformConsole *console, EFI_CONSOLE_CONTROL_SCREEN_MODE mode,
                                 ProtocolSlot slot) {
  // The console splitter's handle carries the graphics output of all screens.
  void *graphics = nullptr;
  if (EFI_ERROR(gBS->HandleProtocol(gST->ConsoleOutHandle, &gEfiGraphicsOutputProtocolGuid, &graphics))) {
    if (EFI_ERROR(gBS->LocateProtocol(&gEfiGraphicsOutputProtocolGuid, nullptr, &graphics))) {
      graphics = nullptr;
    }
  }
  const EFI_STATUS status =
      ConsoleControlInit(console, gST->ConOut, static_cast<EFI_GRAPHICS_OUTPUT_PROTOCOL *>(graphics), mode);
  if (EFI_ERROR(status)) {
    return status;
  }
  return ProtocolPut(slot, gEfiConsoleControlProtocolGuid, &console->protocol);
}

}  // namespace nimb::platform
