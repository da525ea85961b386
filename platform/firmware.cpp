#include "firmware.h"

namespace nimb::platform {

EFI_SYSTEM_TABLE *gST;
EFI_BOOT_SERVICES *gBS;
EFI_RUNTIME_SERVICES *gRT;
EFI_HANDLE gImageHandle;
void (*gOnFirmwareProtocol)(const char *name, bool replaced);

namespace {

// The firmware's interfaces that the platform's replaced: one for each kind
// of protocol that it serves.
struct Replaced {
  EFI_HANDLE handle;
  const EFI_GUID *guid;
  void *firmware;
  void *ours;
};
Replaced gReplaced[8];
UINTN gReplacedCount;

}  // namespace

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
  if (slot.firmware == nullptr) {
    return gBS->InstallProtocolInterface(&slot.handle, &guid, EFI_NATIVE_INTERFACE, ours);
  }
  const EFI_STATUS status = reinterpret_cast<EFI_REINSTALL_PROTOCOL_INTERFACE>(
      gBS->ReinstallProtocolInterface)(slot.handle, &guid, slot.firmware, ours);
  if (!EFI_ERROR(status) && gReplacedCount < sizeof(gReplaced) / sizeof(gReplaced[0])) {
    gReplaced[gReplacedCount++] = {slot.handle, &guid, slot.firmware, ours};
  }
  return status;
}

UINTN ProtocolsGiveBack() {
  UINTN given = 0;
  for (; gReplacedCount > 0; gReplacedCount--) {
    const Replaced &r = gReplaced[gReplacedCount - 1];
    given += EFI_ERROR(reinterpret_cast<EFI_REINSTALL_PROTOCOL_INTERFACE>(gBS->ReinstallProtocolInterface)(
                 r.handle, r.guid, r.ours, r.firmware))
                 ? 0
                 : 1;
  }
  return given;
}

}  // namespace nimb::platform
