#include "load/kernel.h"

namespace nimb {

// This build has no kernel object loader yet: every kernel load fails, and
// the boot ends on its failure path with the kernel's name.
EFI_STATUS LoadKernelFile(EFI_LOAD_FILE_INTERFACE *, EFI_FILE *) {
  return EFI_UNSUPPORTED;
}

}  // namespace nimb
