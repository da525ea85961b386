// The vendor's device properties protocol, which the firmware lacks: it
// gives the blob of device properties that the configuration holds
// (device-properties-hex), which the loader hands on to the kernel.
#pragma once

#include "config.h"
#include "efi/efi.h"
#include "efi/vendor.h"
#include "firmware.h"

namespace nimb::platform {

struct PlatformDeviceProperties {
  // First, so that the protocol's `This` is the whole record.
  NIMB_DEVICE_PROPERTIES_PROTOCOL protocol;
  ConfigBytes blob;
  // Hears of every call of GetProperties with the room passed in, the status
  // given back and the size passed out; null for none.
  void (*onGetProperties)(UINT32 room, EFI_STATUS status, UINT32 size);
};

// Fills in the protocol over `blob`, which must be given. GetProperties
// copies the blob when `*BufferSize` has room for it and sets `*BufferSize`
// to its size; otherwise it sets `*BufferSize` to the size needed and answers
// EFI_BUFFER_TOO_SMALL. No one hears of the calls yet.
void DevicePropertiesInit(PlatformDeviceProperties *properties, const ConfigBytes &blob);

// Initialises `properties` and puts its protocol into `slot`.
EFI_STATUS DevicePropertiesInstall(PlatformDeviceProperties *properties, const ConfigBytes &blob,
                                   ProtocolSlot slot);

}  // namespace nimb::platform
