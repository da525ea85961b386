// A host firmware of its own for one case of a resume test, with the
// loader's tables on it and a hibernated machine to install.
#pragma once

#include <openssl/evp.h>

#include "loader_fixture.h"
#include "resume_image.h"

namespace nimbtest {

struct ResumeScene {
  hostfw::Firmware fw;
  HibernatedMachine machine;
  ResumeImage image;
  explicit ResumeScene(bool acpi = true) {
    ResetLoaderState();
    if (acpi)
      fw.InstallAcpi({});
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

// An image of three restart pages read through extents of several sizes,
// one of them empty.
inline ResumeImageSpec ThreePageSpec() {
  ResumeImageSpec spec;
  spec.restorePageCount = 3;
  spec.firstStageBytes = 0xA000;
  spec.imageBytes = 0x10000;
  spec.extentLengths = {0x1200, 0x600, 0x3000, 0x100, 0};
  return spec;
}

// OpenSSL's AES-CBC without padding, the reference.
inline std::vector<uint8_t> OpensslCbc(bool encrypt, const std::vector<uint8_t> &key, const uint8_t *iv,
                                       const std::vector<uint8_t> &data) {
  const EVP_CIPHER *type = key.size() == 16   ? EVP_aes_128_cbc()
                           : key.size() == 24 ? EVP_aes_192_cbc()
                                              : EVP_aes_256_cbc();
  EVP_CIPHER_CTX *context = EVP_CIPHER_CTX_new();
  std::vector<uint8_t> out(data.size() + 16);
  int length = 0, tail = 0;
  EVP_CipherInit_ex(context, type, nullptr, key.data(), iv, encrypt ? 1 : 0);
  EVP_CIPHER_CTX_set_padding(context, 0);
  EVP_CipherUpdate(context, out.data(), &length, data.data(), static_cast<int>(data.size()));
  EVP_CipherFinal_ex(context, out.data() + length, &tail);
  EVP_CIPHER_CTX_free(context);
  out.resize(static_cast<size_t>(length + tail));
  return out;
}

}  // namespace nimbtest
