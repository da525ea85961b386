// The call gate's image (gate.S) and its copy below 4 GiB.
#pragma once

#include "efi/efi.h"

extern "C" const UINT8 CallGateStart[];
extern "C" const UINT8 CallGateEnd[];

namespace nimb {

inline UINTN CallGateSize() {
  return static_cast<UINTN>(CallGateEnd - CallGateStart);
}

// Takes pages of type EfiLoaderCode at or below 0xFFFFFFFF and copies the
// gate's bytes there; gCallGate holds the copy's address. Returns the
// firmware's status of the allocation.
EFI_STATUS CopyCallGate();

}  // namespace nimb
