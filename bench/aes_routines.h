// The loader's AES decryption, compiled with the firmware build's code
// generation (aes_routines.cpp in the nimb_bench_firmware object library),
// behind plain signatures: the context is opaque here.
#pragma once

#include <cstddef>
#include <cstdint>

struct AesRoutines {
  static constexpr size_t kContextBytes = 244;
  void (*expand)(const uint8_t *key, int32_t keyLength, void *context);
  void (*decrypt)(const uint8_t *input, const uint8_t *iv, uint32_t blockCount, uint8_t *output,
                  const void *context);
  // Chooses the table path or the instructions path; false when the
  // processor cannot take the one asked for.
  bool (*usePath)(bool instructions);
};

extern const AesRoutines gAesFirmwareBuild;
