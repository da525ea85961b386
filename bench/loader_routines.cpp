// The loader's checksums, memory routines and LZSS decoder behind the plain signatures of
// routines.h. LOADER_ROUTINES names the table this compilation defines.
#include "load/lzss.h"
#include "routines.h"
#include "support/checksum.h"
#include "support/strings.h"

namespace {

uint32_t Adler32(const uint8_t *data, size_t length) {
  return __builtin_bswap32(nimb::Adler32(data, length));
}

void Md5(const uint8_t *data, size_t length, uint8_t digest[16]) {
  nimb::Md5Context context;
  nimb::Md5Init(&context);
  nimb::Md5Update(&context, data, static_cast<UINT32>(length));
  nimb::Md5Final(digest, &context);
}

void *Memcpy(void *destination, const void *source, size_t count) {
  return nimb::memcpy(destination, source, count);
}

int Memcmp(const void *a, const void *b, size_t count) {
  return nimb::memcmp(a, b, count);
}

uint64_t DecompressLzss(uint8_t *destination, uint64_t capacity, const uint8_t *source, uint32_t length) {
  return nimb::DecompressLzss(destination, capacity, source, length);
}

}  // namespace

extern const LoaderRoutines LOADER_ROUTINES = {Adler32, Md5, Memcpy, Memcmp, DecompressLzss};
