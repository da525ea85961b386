#include "key_state.h"

#include "firmware.h"

namespace nimb::platform {

namespace {

EFI_STATUS EFIAPI ReadKeyState(NIMB_KEY_STATE_PROTOCOL *This, UINT16 *Modifiers, UINTN *KeyCount,
                               UINT16 *Keys) {
  if (This == nullptr || Modifiers == nullptr || KeyCount == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  const HeldKeys &held = reinterpret_cast<PlatformKeyState *>(This)->held;
  *Modifiers = held.modifiers;
  if (*KeyCount < held.count) {
    *KeyCount = held.count;
    return EFI_BUFFER_TOO_SMALL;
  }
  if (Keys == nullptr && held.count != 0) {
    return EFI_INVALID_PARAMETER;
  }
  for (UINT32 i = 0; i < held.count; i++) {
    Keys[i] = held.keys[i];
  }
  *KeyCount = held.count;
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI GetKeysIgnored(NIMB_BOOT_POLICY_PROTOCOL *This, UINT64 *Ignored) {
  if (This == nullptr || Ignored == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  *Ignored = reinterpret_cast<PlatformBootPolicy *>(This)->keysIgnored ? 1 : 0;
  return EFI_SUCCESS;
}

constexpr UINT16 kKeyboardPage = 0x7000;

// The firmware's shift state bits and the HID modifier bits they become.
constexpr UINT32 kShiftBits[][2] = {
    {EFI_LEFT_CONTROL_PRESSED, 0x01},  {EFI_LEFT_SHIFT_PRESSED, kKeyModifierLeftShift},
    {EFI_LEFT_ALT_PRESSED, 0x04},      {EFI_LEFT_LOGO_PRESSED, kKeyModifierLeftGui},
    {EFI_RIGHT_CONTROL_PRESSED, 0x10}, {EFI_RIGHT_SHIFT_PRESSED, kKeyModifierRightShift},
    {EFI_RIGHT_ALT_PRESSED, 0x40},     {EFI_RIGHT_LOGO_PRESSED, kKeyModifierRightGui},
};

// The characters of the HID usages from 0x04 on (US layout), without and
// with Shift; 0x7F stands for the usage that no US key has.
constexpr UINT16 kFirstCharUsage = 0x04;
constexpr char kPlainChars[] = "abcdefghijklmnopqrstuvwxyz1234567890\r\x1b\b\t -=[]\\\x7f;'`,./";
constexpr char kShiftedChars[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZ!@#$%^&*()\r\x1b\b\t _+{}|\x7f:\"~<>?";
static_assert(sizeof(kPlainChars) == sizeof(kShiftedChars) && sizeof(kPlainChars) - 1 == 0x38 - 0x04 + 1,
              "usages 0x04 to 0x38");

// The HID usages of the firmware's scan codes 1 (Up) to 0x17 (Escape).
constexpr UINT8 kScanUsages[] = {0x52, 0x51, 0x4F, 0x50, 0x4A, 0x4D, 0x49, 0x4C, 0x4B, 0x4E, 0x3A, 0x3B,
                                 0x3C, 0x3D, 0x3E, 0x3F, 0x40, 0x41, 0x42, 0x43, 0x44, 0x45, 0x29};

// The HID usage of a keystroke; 0 for none.
UINT16 KeyUsage(const EFI_KEY_DATA &reading) {
  const EFI_INPUT_KEY &key = reading.Key;
  if (key.ScanCode != 0) {
    return key.ScanCode <= sizeof(kScanUsages) ? kScanUsages[key.ScanCode - 1] : 0;
  }
  const CHAR16 c = key.UnicodeChar;
  const UINT32 shift = reading.KeyState.KeyShiftState;
  const bool control = (shift & EFI_SHIFT_STATE_VALID) != 0 &&
                       (shift & (EFI_LEFT_CONTROL_PRESSED | EFI_RIGHT_CONTROL_PRESSED)) != 0;
  if (control && c >= 1 && c <= 26) {
    return static_cast<UINT16>(kFirstCharUsage + c - 1);  // Control and a letter
  }
  for (UINT32 i = 0; c != 0 && c != 0x7F && i + 1 < sizeof(kPlainChars); i++) {
    if (c == static_cast<UINT8>(kPlainChars[i]) || c == static_cast<UINT8>(kShiftedChars[i])) {
      return static_cast<UINT16>(kFirstCharUsage + i);
    }
  }
  return 0;
}

// Readings per 10 ms step: more than a keyboard's buffer holds of held keys.
constexpr UINT32 kReadingsPerStep = 4 * kMaxHeldKeys;
constexpr UINT32 kStepMicroseconds = 10000;
constexpr EFI_KEY_TOGGLE_STATE kLockBits = 0x07;  // Scroll, Num and Caps Lock

EFI_SIMPLE_TEXT_INPUT_EX_PROTOCOL *FindKeyboard() {
  void *input = nullptr;
  if (gST->ConsoleInHandle == nullptr ||
      EFI_ERROR(gBS->HandleProtocol(gST->ConsoleInHandle, &gEfiSimpleTextInputExProtocolGuid, &input))) {
    if (EFI_ERROR(gBS->LocateProtocol(&gEfiSimpleTextInputExProtocolGuid, nullptr, &input))) {
      input = nullptr;
    }
  }
  return static_cast<EFI_SIMPLE_TEXT_INPUT_EX_PROTOCOL *>(input);
}

// One reading: a keystroke, or with none waiting the shift state now (which
// the firmware may give, or not).
bool ReadOnce(EFI_SIMPLE_TEXT_INPUT_EX_PROTOCOL *input, HeldKeys *held, EFI_KEY_DATA *reading) {
  *reading = {};
  const bool stroke = !EFI_ERROR(input->ReadKeyStrokeEx(input, reading));
  HeldKeysAdd(held, *reading, stroke);
  return stroke;
}

}  // namespace

void KeyStateInit(PlatformKeyState *state, const HeldKeys &held) {
  state->protocol = {};
  state->protocol.ReadKeyState = ReadKeyState;
  state->held = held;
}

void BootPolicyInit(PlatformBootPolicy *policy, bool keysIgnored) {
  policy->protocol = {};
  policy->protocol.GetKeysIgnored = GetKeysIgnored;
  policy->keysIgnored = keysIgnored;
}

void HeldKeysAdd(HeldKeys *held, const EFI_KEY_DATA &reading, bool stroke) {
  const UINT32 shift = reading.KeyState.KeyShiftState;
  if ((shift & EFI_SHIFT_STATE_VALID) != 0) {
    UINT16 modifiers = 0;
    for (const auto &bits : kShiftBits) {
      modifiers = static_cast<UINT16>(modifiers | ((shift & bits[0]) != 0 ? bits[1] : 0));
    }
    held->modifiers = modifiers;
  }
  const UINT16 usage = stroke ? KeyUsage(reading) : 0;
  if (usage == 0 || held->count == kMaxHeldKeys) {
    return;
  }
  const UINT16 key = static_cast<UINT16>(kKeyboardPage + usage);
  for (UINT32 i = 0; i < held->count; i++) {
    if (held->keys[i] == key) {
      return;
    }
  }
  held->keys[held->count++] = key;
}

KeySample KeyStateSample(HeldKeys *held, UINT32 window) {
  KeySample sample = {EFI_UNSUPPORTED, EFI_NOT_STARTED, 0};
  EFI_SIMPLE_TEXT_INPUT_EX_PROTOCOL *input = FindKeyboard();
  if (input == nullptr) {
    return sample;
  }
  sample.status = EFI_SUCCESS;
  // The lock keys stay as they are, when the first reading tells them.
  EFI_KEY_DATA reading;
  sample.strokes += ReadOnce(input, held, &reading) ? 1 : 0;
  EFI_KEY_TOGGLE_STATE before = reading.KeyState.KeyToggleState;
  if ((before & EFI_TOGGLE_STATE_VALID) == 0) {
    before = EFI_TOGGLE_STATE_VALID;
  }
  EFI_KEY_TOGGLE_STATE exposed = static_cast<EFI_KEY_TOGGLE_STATE>(
      EFI_TOGGLE_STATE_VALID | EFI_KEY_STATE_EXPOSED | (before & kLockBits));
  sample.exposeState = input->SetState(input, &exposed);
  for (UINT32 waited = 0;; waited += kStepMicroseconds) {
    for (UINT32 i = 0; i < kReadingsPerStep && ReadOnce(input, held, &reading); i++) {
      sample.strokes++;
    }
    if (waited >= window) {
      break;
    }
    gBS->Stall(kStepMicroseconds);
  }
  if (!EFI_ERROR(sample.exposeState)) {
    input->SetState(input, &before);
  }
  return sample;
}

EFI_STATUS KeyProtocolsInstall(PlatformKeyState *state, PlatformBootPolicy *policy,
                               const PlatformConfig &config, KeySample *sample) {
  *sample = {EFI_NOT_STARTED, EFI_NOT_STARTED, 0};
  ProtocolSlot slot;
  if (ProtocolClaim(gNimbKeyStateProtocolGuid, "key state", config.replaceFirmwareProtocols, &slot)) {
    HeldKeys held = config.keys;
    if (!config.keysGiven) {
      *sample = KeyStateSample(&held, kKeySampleMicroseconds);
    }
    KeyStateInit(state, held);
    const EFI_STATUS status = ProtocolPut(slot, gNimbKeyStateProtocolGuid, &state->protocol);
    if (EFI_ERROR(status)) {
      return status;
    }
  }
  if (!ProtocolClaim(gNimbBootPolicyProtocolGuid, "boot policy", config.replaceFirmwareProtocols, &slot)) {
    return EFI_SUCCESS;
  }
  BootPolicyInit(policy, config.keysIgnored);
  return ProtocolPut(slot, gNimbBootPolicyProtocolGuid, &policy->protocol);
}

}  // namespace nimb::platform
