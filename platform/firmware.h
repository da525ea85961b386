// The platform layer's view of the firmware: its tables, kept at entry, and
// the few definitions that the shared EFI header leaves as untyped slots.
#pragma once

#include "efi/efi.h"
#include "efi/textin.h"

namespace nimb::platform {

extern EFI_SYSTEM_TABLE *gST;
extern EFI_BOOT_SERVICES *gBS;
extern EFI_RUNTIME_SERVICES *gRT;
extern EFI_HANDLE gImageHandle;

// Boot services slots that efi.h types as `void *`.
typedef EFI_STATUS(EFIAPI *EFI_IMAGE_UNLOAD)(EFI_HANDLE ImageHandle);
typedef EFI_STATUS(EFIAPI *EFI_REINSTALL_PROTOCOL_INTERFACE)(EFI_HANDLE Handle, const EFI_GUID *Protocol,
                                                             VOID *OldInterface, VOID *NewInterface);

// Where a protocol that the platform serves goes: the handle that carries
// the firmware's own interface (or the handle to install on; null: a new
// one) and that interface, null when the firmware has none.
struct ProtocolSlot {
  EFI_HANDLE handle;
  void *firmware;
};

// Hears of each protocol that the firmware has of its own, by name, and
// whether the platform's replaces it; null: no one.
extern void (*gOnFirmwareProtocol)(const char *name, bool replaced);

// Looks for the firmware's own `guid` (the first handle that has it) and
// fills in `slot`. True when the platform is to put its own there: always
// when the firmware has none, else only with `replace`, in which case it
// takes the firmware's place on the same handle rather than standing beside
// it where nobody looks.
bool ProtocolClaim(const EFI_GUID &guid, const char *name, bool replace, ProtocolSlot *slot);

// Puts `ours` into the slot: in place of the firmware's interface, or on
// `slot.handle` (a new handle when null).
EFI_STATUS ProtocolPut(ProtocolSlot slot, const EFI_GUID &guid, void *ours);

// Puts the firmware's own interfaces back in the places where ProtocolPut
// replaced them, before the platform goes back to the firmware. Returns how
// many it put back.
UINTN ProtocolsGiveBack();
typedef EFI_STATUS(EFIAPI *EFI_WAIT_FOR_EVENT)(UINTN NumberOfEvents, EFI_EVENT *Event, UINTN *Index);
typedef EFI_STATUS(EFIAPI *EFI_PROTOCOLS_PER_HANDLE)(EFI_HANDLE Handle, EFI_GUID ***ProtocolBuffer,
                                                     UINTN *ProtocolBufferCount);
typedef EFI_STATUS(EFIAPI *EFI_UNINSTALL_PROTOCOL_INTERFACE)(EFI_HANDLE Handle, const EFI_GUID *Protocol,
                                                             VOID *Interface);

// The firmware's keyboard, as the system table's ConIn (its keys as the
// extended text input has them).
struct EFI_SIMPLE_TEXT_INPUT_PROTOCOL {
  EFI_STATUS(EFIAPI *Reset)(EFI_SIMPLE_TEXT_INPUT_PROTOCOL *This, BOOLEAN ExtendedVerification);
  EFI_STATUS(EFIAPI *ReadKeyStroke)(EFI_SIMPLE_TEXT_INPUT_PROTOCOL *This, EFI_INPUT_KEY *Key);
  EFI_EVENT WaitForKey;
};

// A file path media node: the header, then the UCS-2 path with its NUL.
struct FILEPATH_DEVICE_PATH {
  EFI_DEVICE_PATH_PROTOCOL Header;
  CHAR16 PathName[1];
};

// Room for a file's EFI_FILE_INFO with a name of up to 511 characters.
constexpr UINTN kFileInfoBufferSize = SIZE_OF_EFI_FILE_INFO + 512 * sizeof(CHAR16);

}  // namespace nimb::platform
