// The firmware's PXE base code: what the platform layer uses of it to serve
// files over TFTP on a network boot. Names as the UEFI standard spells them;
// function slots that nobody calls are `void *`, and the layouts are checked
// at the end.
#pragma once

#include "efi/efi.h"

union EFI_IP_ADDRESS {
  UINT32 Addr[4];
  UINT8 v4[4];
  UINT8 v6[16];
};

struct EFI_MAC_ADDRESS {
  UINT8 Addr[32];
};

// Messaging device path node of a network interface.
struct MAC_ADDR_DEVICE_PATH {
  EFI_DEVICE_PATH_PROTOCOL Header;
  EFI_MAC_ADDRESS MacAddress;
  UINT8 IfType;
};

enum EFI_PXE_BASE_CODE_TFTP_OPCODE : UINT32 {
  EFI_PXE_BASE_CODE_TFTP_FIRST,
  EFI_PXE_BASE_CODE_TFTP_GET_FILE_SIZE,
  EFI_PXE_BASE_CODE_TFTP_READ_FILE,
  EFI_PXE_BASE_CODE_TFTP_WRITE_FILE,
  EFI_PXE_BASE_CODE_TFTP_READ_DIRECTORY,
  EFI_PXE_BASE_CODE_MTFTP_GET_FILE_SIZE,
  EFI_PXE_BASE_CODE_MTFTP_READ_FILE,
  EFI_PXE_BASE_CODE_MTFTP_READ_DIRECTORY,
  EFI_PXE_BASE_CODE_MTFTP_LAST
};

// A received packet as the base code keeps it: the DHCP/BOOTP message from
// its first byte (the BOOTP op), without the IP and UDP headers.
struct EFI_PXE_BASE_CODE_DHCPV4_PACKET {
  UINT8 BootpOpcode;
  UINT8 BootpHwType;
  UINT8 BootpHwAddrLen;
  UINT8 BootpGateHops;
  UINT32 BootpIdent;
  UINT16 BootpSeconds;
  UINT16 BootpFlags;
  UINT8 BootpCiAddr[4];
  UINT8 BootpYiAddr[4];
  UINT8 BootpSiAddr[4];
  UINT8 BootpGiAddr[4];
  UINT8 BootpHwAddr[16];
  UINT8 BootpSrvName[64];
  UINT8 BootpBootFile[128];
  UINT32 DhcpMagik;
  UINT8 DhcpOptions[56];
};

union EFI_PXE_BASE_CODE_PACKET {
  UINT8 Raw[1472];
  EFI_PXE_BASE_CODE_DHCPV4_PACKET Dhcpv4;
};

struct EFI_PXE_BASE_CODE_MTFTP_INFO {
  EFI_IP_ADDRESS MCastIp;
  UINT16 CPort;
  UINT16 SPort;
  UINT16 ListenTimeout;
  UINT16 TransmitTimeout;
};

#define EFI_PXE_BASE_CODE_MAX_IPCNT 8
#define EFI_PXE_BASE_CODE_MAX_ARP_ENTRIES 8
#define EFI_PXE_BASE_CODE_MAX_ROUTE_ENTRIES 8

struct EFI_PXE_BASE_CODE_IP_FILTER {
  UINT8 Filters;
  UINT8 IpCnt;
  UINT16 reserved;
  EFI_IP_ADDRESS IpList[EFI_PXE_BASE_CODE_MAX_IPCNT];
};

struct EFI_PXE_BASE_CODE_ARP_ENTRY {
  EFI_IP_ADDRESS IpAddr;
  EFI_MAC_ADDRESS MacAddr;
};

struct EFI_PXE_BASE_CODE_ROUTE_ENTRY {
  EFI_IP_ADDRESS IpAddr;
  EFI_IP_ADDRESS SubnetMask;
  EFI_IP_ADDRESS GwAddr;
};

struct EFI_PXE_BASE_CODE_ICMP_ERROR {
  UINT8 Type;
  UINT8 Code;
  UINT16 Checksum;
  UINT32 u;
  UINT8 Data[494];
};

struct EFI_PXE_BASE_CODE_TFTP_ERROR {
  UINT8 ErrorCode;
  CHAR8 ErrorString[127];
};

struct EFI_PXE_BASE_CODE_MODE {
  BOOLEAN Started;
  BOOLEAN Ipv6Available;
  BOOLEAN Ipv6Supported;
  BOOLEAN UsingIpv6;
  BOOLEAN BisSupported;
  BOOLEAN BisDetected;
  BOOLEAN AutoArp;
  BOOLEAN SendGUID;
  BOOLEAN DhcpDiscoverValid;
  BOOLEAN DhcpAckReceived;
  BOOLEAN ProxyOfferReceived;
  BOOLEAN PxeDiscoverValid;
  BOOLEAN PxeReplyReceived;
  BOOLEAN PxeBisReplyReceived;
  BOOLEAN IcmpErrorReceived;
  BOOLEAN TftpErrorReceived;
  BOOLEAN MakeCallbacks;
  UINT8 TTL;
  UINT8 ToS;
  EFI_IP_ADDRESS StationIp;
  EFI_IP_ADDRESS SubnetMask;
  EFI_PXE_BASE_CODE_PACKET DhcpDiscover;
  EFI_PXE_BASE_CODE_PACKET DhcpAck;
  EFI_PXE_BASE_CODE_PACKET ProxyOffer;
  EFI_PXE_BASE_CODE_PACKET PxeDiscover;
  EFI_PXE_BASE_CODE_PACKET PxeReply;
  EFI_PXE_BASE_CODE_PACKET PxeBisReply;
  EFI_PXE_BASE_CODE_IP_FILTER IpFilter;
  UINT32 ArpCacheEntries;
  EFI_PXE_BASE_CODE_ARP_ENTRY ArpCache[EFI_PXE_BASE_CODE_MAX_ARP_ENTRIES];
  UINT32 RouteTableEntries;
  EFI_PXE_BASE_CODE_ROUTE_ENTRY RouteTable[EFI_PXE_BASE_CODE_MAX_ROUTE_ENTRIES];
  EFI_PXE_BASE_CODE_ICMP_ERROR IcmpError;
  EFI_PXE_BASE_CODE_TFTP_ERROR TftpError;
};

struct EFI_PXE_BASE_CODE_PROTOCOL;

typedef EFI_STATUS(EFIAPI *EFI_PXE_BASE_CODE_MTFTP)(EFI_PXE_BASE_CODE_PROTOCOL *This,
                                                    EFI_PXE_BASE_CODE_TFTP_OPCODE Operation, VOID *BufferPtr,
                                                    BOOLEAN Overwrite, UINT64 *BufferSize, UINTN *BlockSize,
                                                    EFI_IP_ADDRESS *ServerIp, UINT8 *Filename,
                                                    EFI_PXE_BASE_CODE_MTFTP_INFO *Info,
                                                    BOOLEAN DontUseBuffer);

struct EFI_PXE_BASE_CODE_PROTOCOL {
  UINT64 Revision;
  void *Start;
  void *Stop;
  void *Dhcp;
  void *Discover;
  EFI_PXE_BASE_CODE_MTFTP Mtftp;
  void *UdpWrite;
  void *UdpRead;
  void *SetIpFilter;
  void *Arp;
  void *SetParameters;
  void *SetStationIp;
  void *SetPackets;
  EFI_PXE_BASE_CODE_MODE *Mode;
};

inline const EFI_GUID gEfiPxeBaseCodeProtocolGuid =
    EFI_GUID_VALUE(0x03C4E603, 0xAC28, 0x11D3, 0x9A, 0x2D, 0x00, 0x90, 0x27, 0x3F, 0xC1, 0x4D);

static_assert(sizeof(EFI_IP_ADDRESS) == 16);
static_assert(sizeof(MAC_ADDR_DEVICE_PATH) == 37);
static_assert(offsetof(MAC_ADDR_DEVICE_PATH, IfType) == 36);
static_assert(offsetof(EFI_PXE_BASE_CODE_DHCPV4_PACKET, BootpSiAddr) == 20);
static_assert(offsetof(EFI_PXE_BASE_CODE_DHCPV4_PACKET, BootpBootFile) == 108);
static_assert(offsetof(EFI_PXE_BASE_CODE_DHCPV4_PACKET, DhcpMagik) == 236);
static_assert(sizeof(EFI_PXE_BASE_CODE_PACKET) == 1472);
static_assert(offsetof(EFI_PXE_BASE_CODE_MTFTP_INFO, CPort) == 16);
static_assert(sizeof(EFI_PXE_BASE_CODE_MTFTP_INFO) == 24);
static_assert(offsetof(EFI_PXE_BASE_CODE_MODE, StationIp) == 20);
static_assert(offsetof(EFI_PXE_BASE_CODE_MODE, DhcpDiscover) == 52);
static_assert(offsetof(EFI_PXE_BASE_CODE_MODE, DhcpAck) == 52 + 1472);
static_assert(offsetof(EFI_PXE_BASE_CODE_MODE, PxeReply) == 52 + 4 * 1472);
static_assert(offsetof(EFI_PXE_BASE_CODE_MODE, IpFilter) == 52 + 6 * 1472);
static_assert(sizeof(EFI_PXE_BASE_CODE_TFTP_ERROR) == 128);
static_assert(offsetof(EFI_PXE_BASE_CODE_PROTOCOL, Mtftp) == 0x28);
static_assert(offsetof(EFI_PXE_BASE_CODE_PROTOCOL, Mode) == 0x68);
