#include "resume/resume.h"

#include "boot/boot.h"
#include "resume/discovery.h"
#include "support/strings.h"

namespace nimb {

void ResumeWipeKey(ResumeState *state) {
  if (state->key != nullptr && state->keyBufferSize != 0) {
    bzero(state->key, state->keyBufferSize);
  }
}

void TryResume() {
  if (!ResumeRequested()) {
    return;
  }
  ResumeState state = {};
  ResumeFindImage(&state);
  // The image's read and restart are not part of this build yet: an
  // accepted image ends like a refused one.
  ResumeWipeKey(&state);
  gRT->ResetSystem(EfiResetCold, EFI_SUCCESS, 0, nullptr);
}

}  // namespace nimb
