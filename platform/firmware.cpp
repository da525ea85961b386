#include "firmware.h"

namespace nimb::platform {

EFI_SYSTEM_TABLE *gST;
EFI_BOOT_SERVICES *gBS;
EFI_RUNTIME_SERVICES *gRT;
EFI_HANDLE gImageHandle;

}  // namespace nimb::platform
