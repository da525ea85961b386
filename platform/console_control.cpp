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
  return Enter(console, mode);
}

EFI_STATUS ConsoleControlInstall(PlatformConsole *console, EFI_CONSOLE_CONTROL_SCREEN_MODE mode) {
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
  EFI_HANDLE handle = nullptr;
  return gBS->InstallProtocolInterface(&handle, &gEfiConsoleControlProtocolGuid, EFI_NATIVE_INTERFACE,
                                       &console->protocol);
}

}  // namespace nimb::platform
