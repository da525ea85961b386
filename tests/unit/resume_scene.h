// A host firmware of its own for one case of a resume test, with the
// loader's tables on it and a hibernated machine to install.
#pragma once

#include "loader_fixture.h"
#include "resume_image.h"

namespace nimbtest {

struct ResumeScene {
  hostfw::Firmware fw;
  HibernatedMachine machine;
  ResumeImage image;
  ResumeScene() {
    ResetLoaderState();
    nimb::gST = fw.SystemTable();
    nimb::gBS = fw.BootServices();
    nimb::gRT = fw.RuntimeServices();
    nimb::gImageHandle = fw.ImageHandle();
    nimb::gCallGate = 0x7000;
  }
  ~ResumeScene() {
    if (nimb::gBS != nullptr)  // boot services not left
      nimb::TrackedFreeAll();
    ResetLoaderState();
  }
  void Install(const ResumeImage &built, const std::vector<uint8_t> &key = std::vector<uint8_t>(16, 0x4B)) {
    image = built;
    machine.Install(fw, image, key);
  }
  void Install(const ResumeImageSpec &spec,
               const std::vector<uint8_t> &key = std::vector<uint8_t>(16, 0x4B)) {
    Install(BuildResumeImage(spec), key);
  }
  bool Has(const CHAR16 *name) { return fw.FindVariable(name, gNimbVendorVariableGuid) != nullptr; }
};

}  // namespace nimbtest
