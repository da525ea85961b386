// The vendor's network boot information protocol, which the firmware lacks:
// it gives the answers of a network boot's servers as the configuration
// holds them (netboot.dhcp-hex, netboot.bsdp-hex), though the machine boots
// from its disk.
#pragma once

#include "config.h"
#include "efi/efi.h"
#include "efi/vendor.h"
#include "firmware.h"

namespace nimb::platform {

struct PlatformNetBootInfo {
  // First, so that the protocol's `This` is the whole record.
  NIMB_NET_BOOT_INFO_PROTOCOL protocol;
  // A null `bytes`: no such answer.
  ConfigBytes dhcp;
  ConfigBytes bsdp;
  // Hears of every call with the answer's name ("dhcp" or "bsdp"), the room
  // passed in, the status given back and the size passed out; null for none.
  void (*onGetResponse)(const char *answer, UINTN room, EFI_STATUS status, UINTN size);
};

// Fills in the protocol over the two answers. Each entry copies its answer
// when `*BufferSize` has room for it and sets `*BufferSize` to its size;
// otherwise it sets `*BufferSize` to the size needed and answers
// EFI_BUFFER_TOO_SMALL, so a size of 0 and a null buffer ask for the size.
// An answer not given is EFI_NOT_FOUND. No one hears of the calls yet.
void NetBootInfoInit(PlatformNetBootInfo *info, const ConfigBytes &dhcp, const ConfigBytes &bsdp);

// Initialises `info` and puts its protocol into `slot`.
EFI_STATUS NetBootInfoInstall(PlatformNetBootInfo *info, const ConfigBytes &dhcp, const ConfigBytes &bsdp,
                              ProtocolSlot slot);

}  // namespace nimb::platform
