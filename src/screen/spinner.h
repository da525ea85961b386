// The spinner of a network boot.
#pragma once

#include "efi/efi.h"

namespace nimb {

// Timer event of the spinner; null when no spinner runs.
extern EFI_EVENT gSpinnerEvent;

}  // namespace nimb
