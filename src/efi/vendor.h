// The vendor's own firmware protocols and variables. All are optional: a
// machine without them boots with the defaults.
#pragma once

#include "efi/efi.h"

// Where the boot loader's NVRAM variables live.
inline const EFI_GUID gNimbVendorVariableGuid =
    EFI_GUID_VALUE(0x7C436110, 0xAB2A, 0x4BBB, 0xA8, 0x80, 0xFE, 0x41, 0x99, 0x5C, 0x9F, 0x82);

// Whether the keys held at start are to be read at all. The answer is
// non-zero when they are to be ignored.
struct NIMB_BOOT_POLICY_PROTOCOL {
  void *Reserved[4];
  EFI_STATUS(EFIAPI *GetKeysIgnored)(NIMB_BOOT_POLICY_PROTOCOL *This, UINT64 *Ignored);
};

inline const EFI_GUID gNimbBootPolicyProtocolGuid =
    EFI_GUID_VALUE(0x8FFEEB3A, 0x4C98, 0x4630, 0x80, 0x3F, 0x74, 0x0F, 0x95, 0x67, 0x09, 0x1D);

// The keys held down, as a USB HID keyboard reports them: a modifier mask
// and up to `*KeyCount` key values of 0x7000 plus the usage.
struct NIMB_KEY_STATE_PROTOCOL {
  void *Reserved;
  EFI_STATUS(EFIAPI *ReadKeyState)
  (NIMB_KEY_STATE_PROTOCOL *This, UINT16 *Modifiers, UINTN *KeyCount, UINT16 *Keys);
};

inline const EFI_GUID gNimbKeyStateProtocolGuid =
    EFI_GUID_VALUE(0x5B213447, 0x6E73, 0x4901, 0xA4, 0xF1, 0xB8, 0x64, 0xF3, 0xB7, 0xA1, 0x72);

constexpr UINT16 kKeyModifierLeftShift = 0x02;
constexpr UINT16 kKeyModifierRightShift = 0x20;
constexpr UINT16 kKeyModifierLeftGui = 0x08;
constexpr UINT16 kKeyModifierRightGui = 0x80;
constexpr UINT16 kKeyS = 0x7016;
constexpr UINT16 kKeyV = 0x7019;

static_assert(offsetof(NIMB_BOOT_POLICY_PROTOCOL, GetKeysIgnored) == 0x20, "the fifth entry");
static_assert(offsetof(NIMB_KEY_STATE_PROTOCOL, ReadKeyState) == 0x08, "the second entry");

// The answers of a network boot's servers: the DHCP answer (first entry)
// and the boot-service discovery answer (second entry). A size of 0 and a
// null buffer ask for the size.
struct NIMB_NET_BOOT_INFO_PROTOCOL {
  EFI_STATUS(EFIAPI *GetDhcpResponse)(NIMB_NET_BOOT_INFO_PROTOCOL *This, UINTN *BufferSize, VOID *Buffer);
  EFI_STATUS(EFIAPI *GetBsdpResponse)(NIMB_NET_BOOT_INFO_PROTOCOL *This, UINTN *BufferSize, VOID *Buffer);
};

inline const EFI_GUID gNimbNetBootInfoProtocolGuid =
    EFI_GUID_VALUE(0x78EE99FB, 0x6A5E, 0x4186, 0x97, 0xDE, 0xCD, 0x0A, 0xBA, 0x34, 0x5A, 0x74);

// The firmware's blob of device properties for the kernel (fifth entry).
struct NIMB_DEVICE_PROPERTIES_PROTOCOL {
  void *Reserved[4];
  EFI_STATUS(EFIAPI *GetProperties)(NIMB_DEVICE_PROPERTIES_PROTOCOL *This, VOID *Buffer, UINT32 *BufferSize);
};

inline const EFI_GUID gNimbDevicePropertiesProtocolGuid =
    EFI_GUID_VALUE(0x91BD12FE, 0xF6C3, 0x44FB, 0xA5, 0xB7, 0x51, 0x22, 0xAB, 0x30, 0x3A, 0xE0);

static_assert(offsetof(NIMB_NET_BOOT_INFO_PROTOCOL, GetBsdpResponse) == 0x08, "the second entry");
static_assert(offsetof(NIMB_DEVICE_PROPERTIES_PROTOCOL, GetProperties) == 0x20, "the fifth entry");

// Where the screen's frame buffer lies and how it is laid out, for code that
// writes to the screen without UGA Draw (first entry). The size is asked for
// and not used.
struct NIMB_FRAME_BUFFER_INFO_PROTOCOL {
  EFI_STATUS(EFIAPI *GetInfo)
  (NIMB_FRAME_BUFFER_INFO_PROTOCOL *This, EFI_PHYSICAL_ADDRESS *FrameBufferBase, UINT32 *FrameBufferSize,
   UINT32 *BytesPerRow, UINT32 *Width, UINT32 *Height, UINT32 *Depth);
};

inline const EFI_GUID gNimbFrameBufferInfoProtocolGuid =
    EFI_GUID_VALUE(0xE316E100, 0x0751, 0x4C49, 0x90, 0x56, 0x48, 0x6C, 0x7E, 0x47, 0x29, 0x03);

static_assert(sizeof(NIMB_FRAME_BUFFER_INFO_PROTOCOL) == 0x08, "one entry");
