// The processor seam on the host: nothing is done to the processor; what the
// loader asked for is recorded and the run goes back to the test.
#include "boot/machine.h"
#include "hostfw/internal.h"

namespace nimb {

// Outside a run there is nothing to record it in, and nothing to protect.
void MachineDisableInterrupts() {
  hostfw::State &s = hostfw::Services::Active();
  if (!s.runs.empty())
    s.runs.back()->result.interruptsDisabled = true;
}

void MachineEnterGate(UINT64 gate, UINT64 argument, UINT64 target) {
  hostfw::State &s = hostfw::Services::Active();
  hostfw::RunResult &result = hostfw::CurrentRun(s, "the call gate").result;
  result.gateAddress = gate;
  result.gateArgument = argument;
  result.gateTarget = target;
  if (s.gateReturns)
    return;
  hostfw::EndRun(s, hostfw::RunEnd::KernelEntered, EFI_SUCCESS);
}

void MachineHalt() {
  hostfw::EndRun(hostfw::Services::Active(), hostfw::RunEnd::Halted, EFI_SUCCESS);
}

}  // namespace nimb
