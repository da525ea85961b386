#include "net_boot.h"

#include "firmware.h"

namespace nimb::platform {

namespace {

constexpr UINTN kDhcpOptionsOffset = 240;  // BOOTP's 236 bytes and the magic cookie
constexpr UINTN kBootpMessageLength = 300;
constexpr UINT8 kDhcpPad = 0;
constexpr UINT8 kDhcpEnd = 255;

UINTN NodeLength(const EFI_DEVICE_PATH_PROTOCOL *node) {
  return static_cast<UINTN>(node->Length[0]) | (static_cast<UINTN>(node->Length[1]) << 8);
}

// The size of `path` up to and with its first MAC address node; 0 when it
// has none.
UINTN NicPathSize(const EFI_DEVICE_PATH_PROTOCOL *path) {
  const UINT8 *bytes = reinterpret_cast<const UINT8 *>(path);
  UINTN size = 0;
  for (;;) {
    const EFI_DEVICE_PATH_PROTOCOL *node = reinterpret_cast<const EFI_DEVICE_PATH_PROTOCOL *>(bytes + size);
    const UINTN length = NodeLength(node);
    if ((node->Type & 0x7F) == END_DEVICE_PATH_TYPE || length < sizeof(EFI_DEVICE_PATH_PROTOCOL)) {
      return 0;
    }
    size += length;
    if (node->Type == MESSAGING_DEVICE_PATH && node->SubType == MSG_MAC_ADDR_DP) {
      return size;
    }
  }
}

bool IsZeroAddress(const UINT8 address[4]) {
  return (address[0] | address[1] | address[2] | address[3]) == 0;
}

}  // namespace

UINTN DhcpMessageLength(const UINT8 *packet, UINTN capacity) {
  static const UINT8 kMagic[4] = {99, 130, 83, 99};
  if (capacity < kDhcpOptionsOffset) {
    return capacity;
  }
  for (UINTN i = 0; i < 4; i++) {
    if (packet[kDhcpOptionsOffset - 4 + i] != kMagic[i]) {
      return kBootpMessageLength < capacity ? kBootpMessageLength : capacity;
    }
  }
  UINTN offset = kDhcpOptionsOffset;
  while (offset < capacity) {
    const UINT8 option = packet[offset];
    if (option == kDhcpEnd) {
      return offset + 1;
    }
    if (option == kDhcpPad) {
      offset++;
    } else if (offset + 1 < capacity) {
      offset += 2 + packet[offset + 1];
    } else {
      break;
    }
  }
  return capacity;
}

EFI_STATUS NetBootStart(EFI_HANDLE device, PlatformNetBoot *boot) {
  *boot = {};
  void *interface = nullptr;
  EFI_STATUS status = gBS->HandleProtocol(device, &gEfiPxeBaseCodeProtocolGuid, &interface);
  if (EFI_ERROR(status)) {
    status = gBS->LocateProtocol(&gEfiPxeBaseCodeProtocolGuid, nullptr, &interface);
  }
  if (EFI_ERROR(status) || interface == nullptr) {
    return EFI_NOT_FOUND;
  }
  boot->pxe = static_cast<EFI_PXE_BASE_CODE_PROTOCOL *>(interface);
  const EFI_PXE_BASE_CODE_MODE *mode = boot->pxe->Mode;
  if (mode == nullptr || !mode->Started || !mode->DhcpAckReceived || mode->UsingIpv6) {
    return EFI_NOT_FOUND;
  }

  status = gBS->HandleProtocol(device, &gEfiDevicePathProtocolGuid, &interface);
  if (EFI_ERROR(status) || interface == nullptr) {
    return EFI_NOT_FOUND;
  }
  const EFI_DEVICE_PATH_PROTOCOL *devicePath = static_cast<EFI_DEVICE_PATH_PROTOCOL *>(interface);
  boot->nicPathSize = NicPathSize(devicePath);
  if (boot->nicPathSize == 0) {
    return EFI_NOT_FOUND;
  }
  status = gBS->AllocatePool(EfiLoaderData, boot->nicPathSize + sizeof(EFI_DEVICE_PATH_PROTOCOL), &interface);
  if (EFI_ERROR(status)) {
    return status;
  }
  UINT8 *path = static_cast<UINT8 *>(interface);
  gBS->CopyMem(path, devicePath, boot->nicPathSize);
  const EFI_DEVICE_PATH_PROTOCOL end = {END_DEVICE_PATH_TYPE, END_ENTIRE_DEVICE_PATH_SUBTYPE, {4, 0}};
  gBS->CopyMem(path + boot->nicPathSize, &end, sizeof(end));
  boot->nicPath = reinterpret_cast<EFI_DEVICE_PATH_PROTOCOL *>(path);

  // The TFTP server is the one that named the boot file: the next server of
  // the DHCP answer, or of a proxy's offer.
  EFI_IP_ADDRESS server = {};
  const UINT8 *next = mode->DhcpAck.Dhcpv4.BootpSiAddr;
  if (IsZeroAddress(next) && mode->ProxyOfferReceived) {
    next = mode->ProxyOffer.Dhcpv4.BootpSiAddr;
  }
  gBS->CopyMem(server.v4, next, 4);
  NetLoadFileInit(&boot->loadFile, boot->pxe, server);

  status = gBS->InstallProtocolInterface(&boot->handle, &gEfiDevicePathProtocolGuid, EFI_NATIVE_INTERFACE,
                                         boot->nicPath);
  if (EFI_ERROR(status)) {
    return status;
  }
  return gBS->InstallProtocolInterface(&boot->handle, &gEfiLoadFileProtocolGuid, EFI_NATIVE_INTERFACE,
                                       &boot->loadFile.protocol);
}

}  // namespace nimb::platform
