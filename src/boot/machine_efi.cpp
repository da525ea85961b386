// The processor seam on the real machine.
#include "boot/machine.h"

namespace nimb {

void MachineDisableInterrupts() {
  __asm__ volatile("cli" ::: "memory");
}

typedef void (*CallGateFunction)(UINT64 argument, UINT64 target);

void MachineCallGate(UINT64 gate, UINT64 argument, UINT64 target) {
  reinterpret_cast<CallGateFunction>(gate)(argument, target);
  // The gate never returns; if the processor ever came back here, stop.
  MachineHalt();
}

void MachineHalt() {
  for (;;) {
    __asm__ volatile("cli; hlt" ::: "memory");
  }
}

}  // namespace nimb
