#include "resume/resume.h"

#include "boot/boot.h"
#include "resume/discovery.h"
#include "resume/image_read.h"
#include "resume/restart.h"
#include "support/strings.h"

namespace nimb {

void ResumeWipeKey(ResumeState *state) {
  if (state->key != nullptr && state->keyBufferSize != 0) {
    bzero(state->key, state->keyBufferSize);
  }
}

ResumeState *gResumeUnderway;

void ResumeResetExit() {
  ResumeState *state = gResumeUnderway;
  if (state == nullptr) {
    return;
  }
  gResumeUnderway = nullptr;
  ResumeWipeKey(state);
  gRT->ResetSystem(EfiResetCold, EFI_SUCCESS, 0, nullptr);
}

void TryResume() {
  if (!ResumeRequested()) {
    return;
  }
  ResumeState state = {};
  gResumeUnderway = &state;
  if (ResumeFindImage(&state) && ResumeReadImage(&state)) {
    // Comes back only when it fails before boot services end.
    ResumeRestart(&state);
  }
  ResumeResetExit();
}

}  // namespace nimb
