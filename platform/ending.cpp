#include "ending.h"

#include "firmware.h"

namespace nimb::platform {

void ShowOnScreen(const char *text) {
  EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *screen = gST->ConOut;
  if (screen == nullptr) {
    return;
  }
  CHAR16 line[128];
  UINTN length = 0;
  for (;; text++) {
    const bool end = *text == '\0';
    if (end || length + 3 == sizeof(line) / sizeof(line[0])) {
      if (end) {
        line[length++] = u'\r';
        line[length++] = u'\n';
      }
      line[length] = 0;
      screen->OutputString(screen, line);
      length = 0;
      if (end) {
        return;
      }
    }
    const UINT8 c = static_cast<UINT8>(*text);
    line[length++] = c >= 0x20 && c < 0x7F ? c : u'?';
  }
}

bool WaitForKeyPress(const char *prompt) {
  EFI_SIMPLE_TEXT_INPUT_PROTOCOL *keyboard = static_cast<EFI_SIMPLE_TEXT_INPUT_PROTOCOL *>(gST->ConIn);
  if (keyboard == nullptr) {
    return false;
  }
  EFI_INPUT_KEY key;
  while (keyboard->ReadKeyStroke(keyboard, &key) == EFI_SUCCESS) {
  }
  // Only now: a key pressed once the prompt shows ends the wait.
  ShowOnScreen(prompt);
  EFI_EVENT event = keyboard->WaitForKey;
  UINTN index = 0;
  for (;;) {
    if (EFI_ERROR(reinterpret_cast<EFI_WAIT_FOR_EVENT>(gBS->WaitForEvent)(1, &event, &index))) {
      gBS->Stall(10000);  // a firmware that cannot wait for the event: poll
    }
    if (keyboard->ReadKeyStroke(keyboard, &key) == EFI_SUCCESS) {
      return true;
    }
  }
}

UINTN UninstallOwnInterfaces() {
  void *interface = nullptr;
  if (EFI_ERROR(gBS->HandleProtocol(gImageHandle, &gEfiLoadedImageProtocolGuid, &interface))) {
    return 0;
  }
  const EFI_LOADED_IMAGE_PROTOCOL *image = static_cast<EFI_LOADED_IMAGE_PROTOCOL *>(interface);
  const UINTN base = reinterpret_cast<UINTN>(image->ImageBase);
  const UINTN size = image->ImageSize;
  UINTN count = 0;
  EFI_HANDLE *handles = nullptr;
  if (EFI_ERROR(gBS->LocateHandleBuffer(AllHandles, nullptr, nullptr, &count, &handles))) {
    return 0;
  }
  const auto perHandle = reinterpret_cast<EFI_PROTOCOLS_PER_HANDLE>(gBS->ProtocolsPerHandle);
  const auto uninstall = reinterpret_cast<EFI_UNINSTALL_PROTOCOL_INTERFACE>(gBS->UninstallProtocolInterface);
  UINTN removed = 0;
  for (UINTN i = 0; i < count; i++) {
    EFI_GUID **guids = nullptr;
    UINTN protocols = 0;
    if (EFI_ERROR(perHandle(handles[i], &guids, &protocols))) {
      continue;
    }
    // The GUIDs are copied first: a handle goes with its last protocol.
    for (UINTN j = 0; j < protocols; j++) {
      const EFI_GUID guid = *guids[j];
      if (!EFI_ERROR(gBS->HandleProtocol(handles[i], &guid, &interface)) &&
          reinterpret_cast<UINTN>(interface) - base < size &&
          !EFI_ERROR(uninstall(handles[i], &guid, interface))) {
        removed++;
      }
    }
    gBS->FreePool(guids);
  }
  gBS->FreePool(handles);
  return removed;
}

}  // namespace nimb::platform
