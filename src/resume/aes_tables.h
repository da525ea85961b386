// The AES decryption tables, constants of the program made by
// tools/aes/make_tables.py. Each table is four sub-tables of 256 words; entry
// x of sub-table 0 is described below, and sub-tables 1 to 3 are sub-table 0
// rotated left (the mixing tables) or its byte moved up (the S-box tables)
// by 8, 16 and 24 bits. Products are those of GF(2^8).
#pragma once

#include "efi/efi.h"

namespace nimb {

// s = InvSbox(x): bytes 14s, 9s, 13s, 11s, low byte first. The rounds
// between the first and the last of decryption.
extern const UINT32 kAesInverseRoundTable[4][256];
// InvSbox(x) in the low byte: the last round of decryption.
extern const UINT32 kAesInverseLastRoundTable[4][256];
// Sbox(x) in the low byte: SubWord in the key expansion.
extern const UINT32 kAesForwardSboxTable[4][256];
// s = x: bytes 14s, 9s, 13s, 11s, low byte first: InvMixColumns of
// schedule words.
extern const UINT32 kAesInverseMixTable[4][256];
// 0x01, 0x02, ... 0x80, 0x1B, 0x36, each in the low byte.
extern const UINT32 kAesRoundConstants[10];

}  // namespace nimb
