// AES decryption (the resume image's first stage is AES-CBC). Decryption
// only: the loader never encrypts.
#pragma once

#include "efi/efi.h"

namespace nimb {

// The expanded key, in the form of the equivalent inverse cipher: round 0
// and the last round as expanded, every round between passed through
// InvMixColumns. Words hold 4 key bytes, the first in the low byte.
struct AesDecryptContext {
  UINT32 schedule[60];
  UINT32 rounds;  // 10, 12 or 14
};
static_assert(sizeof(AesDecryptContext) == 244, "60 schedule words and the round count");

// `keyLength` in bytes (16, 24, 32) or bits (128, 192, 256); any other value
// leaves `context` untouched.
void AesExpandDecryptKey(const UINT8 *key, INT32 keyLength, AesDecryptContext *context);

// CBC decryption of `blockCount` 16-byte blocks, from the last block to the
// first, so that `input` and `output` may be the same. `iv` is not changed.
void AesCbcDecrypt(const UINT8 *input, const UINT8 *iv, UINT32 blockCount, UINT8 *output,
                   const AesDecryptContext *context);

}  // namespace nimb
