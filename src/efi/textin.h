// The extended simple text input protocol: keystrokes with the state of the
// shift keys, and the "key state exposed" toggle, with which a keyboard
// driver also reports a shift key pressed alone (a keystroke of no key and
// no character, only the shift state).
#pragma once

#include "efi/efi.h"

struct EFI_INPUT_KEY {
  UINT16 ScanCode;
  CHAR16 UnicodeChar;
};

typedef UINT8 EFI_KEY_TOGGLE_STATE;

struct EFI_KEY_STATE {
  UINT32 KeyShiftState;
  EFI_KEY_TOGGLE_STATE KeyToggleState;
};

struct EFI_KEY_DATA {
  EFI_INPUT_KEY Key;
  EFI_KEY_STATE KeyState;
};

struct EFI_SIMPLE_TEXT_INPUT_EX_PROTOCOL {
  EFI_STATUS(EFIAPI *Reset)(EFI_SIMPLE_TEXT_INPUT_EX_PROTOCOL *This, BOOLEAN ExtendedVerification);
  EFI_STATUS(EFIAPI *ReadKeyStrokeEx)(EFI_SIMPLE_TEXT_INPUT_EX_PROTOCOL *This, EFI_KEY_DATA *KeyData);
  EFI_EVENT WaitForKeyEx;
  EFI_STATUS(EFIAPI *SetState)(EFI_SIMPLE_TEXT_INPUT_EX_PROTOCOL *This, EFI_KEY_TOGGLE_STATE *KeyToggleState);
  void *RegisterKeyNotify;
  void *UnregisterKeyNotify;
};

// KeyShiftState bits; the others mean nothing without EFI_SHIFT_STATE_VALID.
#define EFI_SHIFT_STATE_VALID 0x80000000U
#define EFI_RIGHT_SHIFT_PRESSED 0x00000001U
#define EFI_LEFT_SHIFT_PRESSED 0x00000002U
#define EFI_RIGHT_CONTROL_PRESSED 0x00000004U
#define EFI_LEFT_CONTROL_PRESSED 0x00000008U
#define EFI_RIGHT_ALT_PRESSED 0x00000010U
#define EFI_LEFT_ALT_PRESSED 0x00000020U
#define EFI_RIGHT_LOGO_PRESSED 0x00000040U
#define EFI_LEFT_LOGO_PRESSED 0x00000080U

// KeyToggleState bits.
#define EFI_TOGGLE_STATE_VALID 0x80U
#define EFI_KEY_STATE_EXPOSED 0x40U

inline const EFI_GUID gEfiSimpleTextInputExProtocolGuid =
    EFI_GUID_VALUE(0xDD9E7534, 0x7762, 0x4698, 0x8C, 0x14, 0xF5, 0x85, 0x17, 0xA6, 0x25, 0xAA);

static_assert(sizeof(EFI_INPUT_KEY) == 4);
static_assert(sizeof(EFI_KEY_DATA) == 12);
static_assert(offsetof(EFI_KEY_DATA, KeyState) == 4);
static_assert(offsetof(EFI_KEY_STATE, KeyToggleState) == 4);
static_assert(offsetof(EFI_SIMPLE_TEXT_INPUT_EX_PROTOCOL, ReadKeyStrokeEx) == 0x08);
static_assert(offsetof(EFI_SIMPLE_TEXT_INPUT_EX_PROTOCOL, SetState) == 0x18);
static_assert(sizeof(EFI_SIMPLE_TEXT_INPUT_EX_PROTOCOL) == 0x30);
