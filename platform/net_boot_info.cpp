#include "net_boot_info.h"

#include "firmware.h"

namespace nimb::platform {

namespace {

// One entry's work: `answer` is the record's field of the entry's answer.
EFI_STATUS Answer(NIMB_NET_BOOT_INFO_PROTOCOL *This, const char *name,
                  ConfigBytes PlatformNetBootInfo::*answer, UINTN *BufferSize, VOID *Buffer) {
  if (This == nullptr || BufferSize == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  const PlatformNetBootInfo *info = reinterpret_cast<PlatformNetBootInfo *>(This);
  const UINTN room = *BufferSize;
  const EFI_STATUS status = ConfigBytesAnswer(info->*answer, Buffer, BufferSize);
  if (info->onGetResponse != nullptr) {
    info->onGetResponse(name, room, status, *BufferSize);
  }
  return status;
}

EFI_STATUS EFIAPI GetDhcpResponse(NIMB_NET_BOOT_INFO_PROTOCOL *This, UINTN *BufferSize, VOID *Buffer) {
  return Answer(This, "dhcp", &PlatformNetBootInfo::dhcp, BufferSize, Buffer);
}

EFI_STATUS EFIAPI GetBsdpResponse(NIMB_NET_BOOT_INFO_PROTOCOL *This, UINTN *BufferSize, VOID *Buffer) {
  return Answer(This, "bsdp", &PlatformNetBootInfo::bsdp, BufferSize, Buffer);
}

}  // namespace

void NetBootInfoInit(PlatformNetBootInfo *info, const ConfigBytes &dhcp, const ConfigBytes &bsdp) {
  info->protocol = {};
  info->protocol.GetDhcpResponse = GetDhcpResponse;
  info->protocol.GetBsdpResponse = GetBsdpResponse;
  info->dhcp = dhcp;
  info->bsdp = bsdp;
  info->onGetResponse = nullptr;
}

EFI_STATUS NetBootInfoInstall(PlatformNetBootInfo *info, const ConfigBytes &dhcp, const ConfigBytes &bsdp,
                              ProtocolSlot slot) {
  NetBootInfoInit(info, dhcp, bsdp);
  return ProtocolPut(slot, gNimbNetBootInfoProtocolGuid, &info->protocol);
}

}  // namespace nimb::platform
