// The restart: the firmware is left for good and the image's restart code
// is entered through the call gate.
#pragma once

#include "resume/resume.h"

namespace nimb {

// Copies `pageCount` pages of restart code to `destination` and sums them:
// each page's Adler-32, taken over the bytes as they stand at the
// destination, added up with wrap-around at 32 bits.
UINT32 ResumeCopyRestartCode(UINT8 *destination, const UINT8 *source, UINT32 pageCount);

// Records the frame buffer, takes the final map, leaves boot services, moves
// the runtime services into the image's area, copies the restart code and
// enters it. Returns only on a failure before boot services have ended;
// behind that point a failure resets the machine from in here.
void ResumeRestart(ResumeState *state);

}  // namespace nimb
