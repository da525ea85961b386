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

EFI_STATUS KeyProtocolsInstall(PlatformKeyState *state, PlatformBootPolicy *policy,
                               const PlatformConfig &config) {
  KeyStateInit(state, config.keys);
  BootPolicyInit(policy, config.keysIgnored);
  EFI_HANDLE handle = nullptr;
  const EFI_STATUS status = gBS->InstallProtocolInterface(&handle, &gNimbKeyStateProtocolGuid,
                                                          EFI_NATIVE_INTERFACE, &state->protocol);
  if (EFI_ERROR(status)) {
    return status;
  }
  handle = nullptr;
  return gBS->InstallProtocolInterface(&handle, &gNimbBootPolicyProtocolGuid, EFI_NATIVE_INTERFACE,
                                       &policy->protocol);
}

}  // namespace nimb::platform
