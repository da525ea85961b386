// Checksums: Adler-32 for the kernel cache, MD5 for name-based UUIDs.
#pragma once

#include "efi/efi.h"

namespace nimb {

// The Adler-32 checksum of `length` bytes, with its four bytes reversed: on
// this little-endian processor the word lies in memory in big-endian order,
// as the kernel cache's header holds it. An empty input gives 0x01000000.
UINT32 Adler32(const void *data, UINT64 length);

struct Md5Context {
  UINT32 state[4];   // A, B, C, D
  UINT32 count[2];   // number of bits so far, modulo 2^64, low word first
  UINT8 buffer[64];  // input not yet transformed
};

void Md5Init(Md5Context *context);
void Md5Update(Md5Context *context, const void *data, UINT32 length);
// Writes the 16 bytes of the digest, then zeroes the whole context: it must
// go through Md5Init again before it is used.
void Md5Final(UINT8 digest[16], Md5Context *context);
// One round of the algorithm over a 64-byte block.
void Md5Transform(UINT32 state[4], const UINT8 block[64]);

}  // namespace nimb
