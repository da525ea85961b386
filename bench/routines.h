// The loader's routines under test, as plain functions over bytes. The same
// source (loader_routines.cpp) is compiled once against the host build of the
// loader's code and once with the firmware build's code generation.
#pragma once

#include <cstddef>
#include <cstdint>

struct LoaderRoutines {
  // The Adler-32 value as zlib gives it (the loader's own is byte-reversed).
  uint32_t (*adler32)(const uint8_t *data, size_t length);
  void (*md5)(const uint8_t *data, size_t length, uint8_t digest[16]);
  void *(*memcpy)(void *destination, const void *source, size_t count);
  int (*memcmp)(const void *a, const void *b, size_t count);
  // The kernel cache's LZSS decoder: bytes written into `destination`.
  uint64_t (*decompressLzss)(uint8_t *destination, uint64_t capacity, const uint8_t *source, uint32_t length);
};

extern const LoaderRoutines gLoaderHostBuild;
extern const LoaderRoutines gLoaderFirmwareBuild;

// A textbook LZSS decoder (a ring of 4096, one byte at a time), compiled
// with the firmware build's code generation: the peer of the loader's.
uint64_t TextbookLzss(uint8_t *destination, uint64_t capacity, const uint8_t *source, uint32_t length);
