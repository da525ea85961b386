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
};

extern const LoaderRoutines gLoaderHostBuild;
extern const LoaderRoutines gLoaderFirmwareBuild;
