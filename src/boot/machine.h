// The few things the loader asks of the processor itself. Each target has
// one small file with their bodies: the EFI build does them for real, the
// host build (hostfw/) records them and hands control back to the test.
#pragma once

#include "efi/efi.h"

namespace nimb {

// Masks maskable interrupts (cli).
void MachineDisableInterrupts();

// Calls the copied call gate at `gate` with `argument` (RCX) and `target`
// (RDX). The gate does not return; should control ever come back, so does
// this call, and the caller has the last word (StopAfterBootServices).
void MachineEnterGate(UINT64 gate, UINT64 argument, UINT64 target);

// Stops the processor for good: the last way out when nothing else is left.
[[noreturn]] void MachineHalt();

// MachineEnterGate for a caller with nothing to say should the gate come back.
[[noreturn]] inline void MachineCallGate(UINT64 gate, UINT64 argument, UINT64 target) {
  MachineEnterGate(gate, argument, target);
  MachineHalt();
}

}  // namespace nimb
