// The vendor's key protocols, which the firmware lacks: the key state
// protocol, which reports the keys held down at start, and the boot policy
// protocol, which tells whether they are to be read at all.
//
// The held keys come from the firmware's keyboard: while the platform starts
// it reads the extended text input of the console for a short while, with
// partial keystrokes exposed, so that a shift key held alone shows too. The
// configuration's `keys=` overrides the keyboard (for tests).
#pragma once

#include "config.h"
#include "efi/efi.h"
#include "efi/textin.h"
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

// Adds what one reading of the firmware's keyboard says to `held`: a valid
// shift state becomes the modifier mask (the latest reading wins, as it is
// the state now), and a key that a HID keyboard has (letters, digits, Enter,
// Escape, Backspace, Tab, Space, the US punctuation, arrows, the editing
// keys, F1 to F12) is added once, in the order first seen, up to
// kMaxHeldKeys. A reading with neither key nor character (a partial
// keystroke) adds only its shift state. A Shift that the firmware folds into
// a character ('V' for Shift-V, no shift bit) is not guessed back.
void HeldKeysAdd(HeldKeys *held, const EFI_KEY_DATA &reading, bool stroke);

// How long the keyboard is read: long enough for a keyboard's repeat of a
// held key, short beside the firmware's own start.
constexpr UINT32 kKeySampleMicroseconds = 200000;

// What the keyboard gave while the platform sampled it.
struct KeySample {
  EFI_STATUS status;       // EFI_UNSUPPORTED: no extended text input
  EFI_STATUS exposeState;  // SetState with the partial keystrokes exposed
  UINT32 strokes;          // keystrokes read
};

// Reads the console's extended text input for `window` microseconds (in
// steps of 10 ms, a bounded number of readings each) into `held`.
KeySample KeyStateSample(HeldKeys *held, UINT32 window);

// Serves both protocols, each unless the firmware has its own and
// `config.replaceFirmwareProtocols` is clear. The held keys are the
// configuration's when it gives `keys=`, else sampled from the keyboard
// (`*sample`; status EFI_NOT_STARTED when not sampled).
EFI_STATUS KeyProtocolsInstall(PlatformKeyState *state, PlatformBootPolicy *policy,
                               const PlatformConfig &config, KeySample *sample);

}  // namespace nimb::platform
