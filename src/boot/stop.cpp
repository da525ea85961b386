#include "boot/stop.h"

#include "boot/boot.h"
#include "boot/machine.h"

namespace nimb {

const char *gStopMessage = nullptr;

void StopAfterBootServices(const char *message, BOOLEAN reset) {
  gStopMessage = message;
  if (reset != 0 && gRT != nullptr) {
    gRT->ResetSystem(EfiResetCold, EFI_SUCCESS, 0, nullptr);
  }
  MachineHalt();
}

}  // namespace nimb
