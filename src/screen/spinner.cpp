#include "screen/spinner.h"

namespace nimb {

EFI_EVENT gSpinnerEvent;

}  // namespace nimb
