#include "firmware.h"

namespace nimb::platform {

EFI_SYSTEM_TABLE *gST;
EFI_BOOT_SERVICES *gBS;
EFI_RUNTIME_SERVICES *gRT;
EFI_HANDLE gImageHandle;
void (*gOnFirmwareProtocol)(const char *name, bool replaced);

bool ProtocolClaim(const EFI_GUID &guid, const char *name, bool replace, ProtocolSlot *slot) {
  *slot = {nullptr, nullptr};
  UINTN count = 0;
  EFI_HANDLE *handles = nullptr;
  if (EFI_ERROR(gBS->LocateHandleBuffer(ByProtocol, &guid, nullptr, &count, &handles))) {
    return true;
  }
  if (count != 0 && !EFI_ERROR(gBS->HandleProtocol(handles[0], &guid, &slot->firmware)) &&
      slot->firmware != nullptr) {
    slot->handle = handles[0];
  } else {
    slot->firmware = nullptr;
  }
  gBS->FreePool(handles);
  if (slot->firmware == nullptr) {
    return true;
  }
  if (gOnFirmwareProtocol != nullptr) {
    gOnFirmwareProtocol(name, replace);
  }
  return replace;
}

EFI_STATUS ProtocolPut(ProtocolSlot slot, const EFI_GUID &guid, void *ours) {
  if (slot.firmware != nullptr) {
    return reinterpret_cast<EFI_REINSTALL_PROTOCOL_INTERFACE>(gBS->ReinstallProtocolInterface)(
        slot.handle, &guid, slot.firmware, ours);
  }
  return gBS->InstallProtocolInterface(&slot.handle, &guid, EFI_NATIVE_INTERFACE, ours);
}

}  // namespace nimb::platform
