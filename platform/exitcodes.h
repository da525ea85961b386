// How a run of the platform layer ends: the byte it writes to the debug-exit
// port when it uses one (QEMU's exit status is then (code << 1) | 1); the
// firmware gets the loader's status back instead elsewhere. The test
// harness (tests/qemu/harness.py) reads the kExit... lines of this file, so
// each constant stays on one line of the form `constexpr UINT8 kExitName = 0x..;`.
#pragma once

#include "efi/efi.h"

namespace nimb::platform {

// The loader came back: its status (EFI_ABORTED, EFI_SUCCESS or any other)
// times whether the firmware's free memory is what it was before the start.
constexpr UINT8 kExitAbortedSame = 0x10;
constexpr UINT8 kExitAbortedChanged = 0x11;
constexpr UINT8 kExitSuccessSame = 0x12;
constexpr UINT8 kExitSuccessChanged = 0x13;
constexpr UINT8 kExitOtherSame = 0x14;
constexpr UINT8 kExitOtherChanged = 0x15;

// The platform layer failed before the loader ran.
constexpr UINT8 kExitConfigInvalid = 0x20;
constexpr UINT8 kExitLoaderMissing = 0x21;
constexpr UINT8 kExitLoadImageFailed = 0x22;
constexpr UINT8 kExitPlatformFailed = 0x23;

constexpr UINT8 ExitCodeForOutcome(EFI_STATUS status, bool memoryChanged) {
  const UINT8 same = status == EFI_ABORTED   ? kExitAbortedSame
                     : status == EFI_SUCCESS ? kExitSuccessSame
                                             : kExitOtherSame;
  return static_cast<UINT8>(same + (memoryChanged ? 1 : 0));
}

}  // namespace nimb::platform
