// Finding the hibernated image and accepting it: the NVRAM request, the
// partition, the offset, the key and the header's checks.
#pragma once

#include "resume/resume.h"

namespace nimb {

// True when `boot-signature` exists; it is then deleted at once. With any
// other answer nothing is touched, and in safe mode (kBootSafeMode)
// nothing is even asked.
BOOLEAN ResumeRequested();

// The rest of the discovery, up to an accepted header in `state`. False on
// any failure: the caller resets. Prints nothing, draws nothing.
BOOLEAN ResumeFindImage(ResumeState *state);

}  // namespace nimb
