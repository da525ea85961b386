// The processor seam on the real machine.
#include "boot/machine.h"

namespace nimb {

void MachineDisableInterrupts() {
  __asm__ volatile("cli" ::: "memory");
}

typedef void (*CallGateFunction)(UINT64 argument, UINT64 target);

void MachineEnterGate(UINT64 gate, UINT64 argument, UINT64 target) {
  reinterpret_cast<CallGateFunction>(gate)(argument, target);
}

void MachineHalt() {
  for (;;) {
    __asm__ volatile("cli; hlt" ::: "memory");
  }
}

}  // namespace nimb
