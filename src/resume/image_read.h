// Reading the hibernated image: the three reservations of the memory plan,
// the walk over the extents in two stages with the preview and the progress
// bar, and the decryption of the first stage.
#pragma once

#include "resume/resume.h"

namespace nimb {

// The memory plan, the read of the first stage and its decryption, with the
// key wiped at the end whatever happened. False on any failure: the caller
// resets.
BOOLEAN ResumeReadImage(ResumeState *state);

}  // namespace nimb
