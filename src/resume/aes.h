// AES decryption (the resume image's first stage is AES-CBC). Decryption
// only: the loader never encrypts.
//
// Two paths share one key schedule: the table-driven one, which runs on any
// processor, and one with the processor's AES instructions, taken where
// CPUID reports them. The schedule is already in the form those
// instructions want, so both give the same bytes.
#pragma once

#include "efi/efi.h"

namespace nimb {

// The expanded key, in the form of the equivalent inverse cipher: round 0
// and the last round as expanded, every round between passed through
// InvMixColumns. Words hold 4 key bytes, the first in the low byte; round r
// is words 4r to 4r + 3. 44, 52 or 60 words are used; the rest stay as they
// were.
struct AesDecryptContext {
  UINT32 schedule[60];
  UINT32 rounds;  // 10, 12 or 14
};
static_assert(sizeof(AesDecryptContext) == 244, "60 schedule words and the round count");

// The number of rounds for a key of `keyLength` bytes (16, 24, 32) or bits
// (128, 192, 256); 0 for any other length, which selects no schedule.
UINT32 AesRoundsForKeyLength(INT32 keyLength);

// `keyLength` in bytes (16, 24, 32) or bits (128, 192, 256); any other value
// leaves `context` untouched. Reads only the bytes of the key size.
void AesExpandDecryptKey(const UINT8 *key, INT32 keyLength, AesDecryptContext *context);

// CBC decryption of `blockCount` 16-byte blocks, from the last block to the
// first, so that `input` and `output` may be the same. `iv` is not changed.
// `context` must hold a schedule made by AesExpandDecryptKey. Either path
// clears the registers that held round keys or state before it returns: the
// general registers (tables) or the vector registers (instructions).
void AesCbcDecrypt(const UINT8 *input, const UINT8 *iv, UINT32 blockCount, UINT8 *output,
                   const AesDecryptContext *context);

// Zeroes `context`, and the vector registers that the instructions path
// uses: once it has run, the loader holds no key material of its own.
void AesWipe(AesDecryptContext *context);

// The path AesCbcDecrypt takes. It is chosen by CPUID at the first use.
enum AesPath : UINT32 {
  kAesPathTables = 1,
  kAesPathInstructions = 2,
};
AesPath AesCurrentPath();
// Forces a path (tests and benchmarks); the instructions only where the
// processor has them. Returns the path now in use.
AesPath AesSetPath(AesPath path);

}  // namespace nimb
