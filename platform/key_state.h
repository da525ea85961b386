// The vendor's key protocols, which the firmware lacks: the key state
// protocol, which reports the keys held down at start, and the boot policy
// protocol, which tells whether they are to be read at all. Both report what
// the configuration says; nothing is read from the real keyboard.
#pragma once

#include "config.h"
#include "efi/efi.h"
#include "efi/vendor.h"

namespace nimb::platform {

struct PlatformKeyState {
  // First, so that the protocol's `This` is the whole record.
  NIMB_KEY_STATE_PROTOCOL protocol;
  HeldKeys held;
};

struct PlatformBootPolicy {
  NIMB_BOOT_POLICY_PROTOCOL protocol;
  bool keysIgnored;
};

// Fills in the protocols. ReadKeyState writes the modifiers and, when
// `*KeyCount` has room for all held keys, the keys and their number;
// otherwise it sets `*KeyCount` to the number needed and answers
// EFI_BUFFER_TOO_SMALL. GetKeysIgnored answers 1 or 0.
void KeyStateInit(PlatformKeyState *state, const HeldKeys &held);
void BootPolicyInit(PlatformBootPolicy *policy, bool keysIgnored);

// Initialises both and installs each on a new handle.
EFI_STATUS KeyProtocolsInstall(PlatformKeyState *state, PlatformBootPolicy *policy,
                               const PlatformConfig &config);

}  // namespace nimb::platform
