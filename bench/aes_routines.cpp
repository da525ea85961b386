// The loader's AES behind the plain signatures of aes_routines.h.
#include "aes_routines.h"

#include "resume/aes.h"

namespace {

static_assert(sizeof(nimb::AesDecryptContext) == AesRoutines::kContextBytes);

void Expand(const uint8_t *key, int32_t keyLength, void *context) {
  nimb::AesExpandDecryptKey(key, keyLength, static_cast<nimb::AesDecryptContext *>(context));
}

void Decrypt(const uint8_t *input, const uint8_t *iv, uint32_t blockCount, uint8_t *output,
             const void *context) {
  nimb::AesCbcDecrypt(input, iv, blockCount, output, static_cast<const nimb::AesDecryptContext *>(context));
}

bool UsePath(bool instructions) {
  const nimb::AesPath path = instructions ? nimb::kAesPathInstructions : nimb::kAesPathTables;
  return nimb::AesSetPath(path) == path;
}

}  // namespace

extern const AesRoutines gAesFirmwareBuild = {Expand, Decrypt, UsePath};
