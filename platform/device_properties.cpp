#include "device_properties.h"

#include "firmware.h"

namespace nimb::platform {

namespace {

EFI_STATUS EFIAPI GetProperties(NIMB_DEVICE_PROPERTIES_PROTOCOL *This, VOID *Buffer, UINT32 *BufferSize) {
  if (This == nullptr || BufferSize == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  const PlatformDeviceProperties *properties = reinterpret_cast<PlatformDeviceProperties *>(This);
  const UINT32 room = *BufferSize;
  UINTN size = room;
  const EFI_STATUS status = ConfigBytesAnswer(properties->blob, Buffer, &size);
  *BufferSize = static_cast<UINT32>(size);
  if (properties->onGetProperties != nullptr) {
    properties->onGetProperties(room, status, *BufferSize);
  }
  return status;
}

}  // namespace

void DevicePropertiesInit(PlatformDeviceProperties *properties, const ConfigBytes &blob) {
  properties->protocol = {};
  properties->protocol.GetProperties = GetProperties;
  properties->blob = blob;
  properties->onGetProperties = nullptr;
}

EFI_STATUS DevicePropertiesInstall(PlatformDeviceProperties *properties, const ConfigBytes &blob,
                                   ProtocolSlot slot) {
  DevicePropertiesInit(properties, blob);
  return ProtocolPut(slot, gNimbDevicePropertiesProtocolGuid, &properties->protocol);
}

}  // namespace nimb::platform
