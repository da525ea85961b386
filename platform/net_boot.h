// A network boot of the platform layer: when the firmware's PXE started it,
// the network device it came from serves the loader's files by name.
#pragma once

#include "efi/efi.h"
#include "efi/pxe.h"
#include "net_load_file.h"

namespace nimb::platform {

struct PlatformNetBoot {
  // The base code on the boot device, started by the firmware's boot.
  EFI_PXE_BASE_CODE_PROTOCOL *pxe;
  // The NIC's device path up to and with its MAC address node, and the end.
  EFI_DEVICE_PATH_PROTOCOL *nicPath;
  UINTN nicPathSize;  // without the end node
  // The new handle with that path and the file loader.
  EFI_HANDLE handle;
  PlatformNetLoadFile loadFile;
};

// The length of a DHCP message kept in a base code packet of `capacity`
// bytes: through its end option, or `capacity` when none comes; a message
// without the DHCP magic cookie is a plain BOOTP message of 300 bytes.
UINTN DhcpMessageLength(const UINT8 *packet, UINTN capacity);

// Finds the base code and the NIC of `device` (the handle the firmware
// booted the platform from) and installs the file loader on a new handle.
// EFI_NOT_FOUND: no base code with a DHCP answer, or no MAC node in the
// device's path; other errors are the firmware's.
EFI_STATUS NetBootStart(EFI_HANDLE device, PlatformNetBoot *boot);

}  // namespace nimb::platform
