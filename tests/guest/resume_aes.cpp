// The probe's own AES key expansion, from the field arithmetic (no tables):
// it has to know the round keys that the loader may have left behind.
#include "resume_probe.h"

namespace nimb::guest {

namespace {

uint8_t Times(uint8_t a, uint8_t b) {
  uint8_t product = 0;
  while (b != 0) {
    if ((b & 1) != 0) {
      product ^= a;
    }
    a = static_cast<uint8_t>(a << 1 ^ ((a & 0x80) != 0 ? 0x1B : 0));
    b >>= 1;
  }
  return product;
}

uint8_t SubByte(uint8_t x) {
  // The inverse is x^254.
  uint8_t inverse = 1;
  for (int i = 0; i < 254; i++) {
    inverse = Times(inverse, x);
  }
  if (x == 0) {
    inverse = 0;
  }
  uint8_t s = inverse;
  for (int shift = 1; shift <= 4; shift++) {
    s ^= static_cast<uint8_t>(inverse << shift | inverse >> (8 - shift));
  }
  return s ^ 0x63;
}

void InvMixColumn(const uint8_t *in, uint8_t *out) {
  for (int row = 0; row < 4; row++) {
    out[row] = Times(in[row], 14) ^ Times(in[(row + 1) % 4], 11) ^ Times(in[(row + 2) % 4], 13) ^
               Times(in[(row + 3) % 4], 9);
  }
}

bool SameBlock(const uint8_t *a, const uint8_t *b) {
  for (int i = 0; i < 16; i++) {
    if (a[i] != b[i]) {
      return false;
    }
  }
  return true;
}

}  // namespace

uint32_t AesRoundKeys(const uint8_t *key, uint32_t keyBytes, uint8_t (*out)[16]) {
  const uint32_t nk = keyBytes / 4;
  if (keyBytes != 16 && keyBytes != 24 && keyBytes != 32) {
    return 0;
  }
  const uint32_t rounds = nk + 6;
  uint8_t words[60][4];
  uint8_t rcon = 1;
  for (uint32_t i = 0; i < 4 * (rounds + 1); i++) {
    if (i < nk) {
      for (int j = 0; j < 4; j++) {
        words[i][j] = key[4 * i + j];
      }
      continue;
    }
    uint8_t t[4] = {words[i - 1][0], words[i - 1][1], words[i - 1][2], words[i - 1][3]};
    if (i % nk == 0) {
      const uint8_t first = t[0];
      t[0] = SubByte(t[1]) ^ rcon;
      t[1] = SubByte(t[2]);
      t[2] = SubByte(t[3]);
      t[3] = SubByte(first);
      rcon = Times(rcon, 2);
    } else if (nk > 6 && i % nk == 4) {
      for (int j = 0; j < 4; j++) {
        t[j] = SubByte(t[j]);
      }
    }
    for (int j = 0; j < 4; j++) {
      words[i][j] = words[i - nk][j] ^ t[j];
    }
  }
  uint32_t count = 0;
  for (uint32_t round = 0; round <= rounds; round++) {
    const uint8_t *plain = &words[0][0] + 16 * round;
    if (4 * round + 3 >= nk) {
      for (int j = 0; j < 16; j++) {
        out[count][j] = plain[j];
      }
      count++;
    }
    if (round == 0 || round == rounds) {
      continue;
    }
    uint8_t inverse[16];
    for (int column = 0; column < 4; column++) {
      InvMixColumn(plain + 4 * column, inverse + 4 * column);
    }
    if (!SameBlock(inverse, plain)) {
      for (int j = 0; j < 16; j++) {
        out[count][j] = inverse[j];
      }
      count++;
    }
  }
  return count;
}

uint32_t Adler32(uint32_t adler, const uint8_t *bytes, uint32_t length) {
  uint32_t a = adler & 0xFFFF, b = adler >> 16;
  while (length != 0) {
    uint32_t chunk = length < 5552 ? length : 5552;
    length -= chunk;
    while (chunk-- != 0) {
      a += *bytes++;
      b += a;
    }
    a %= 65521;
    b %= 65521;
  }
  return b << 16 | a;
}

uint32_t Adler32Pages(const uint8_t *code, uint32_t pages) {
  uint32_t total = 0;
  for (uint32_t page = 0; page < pages; page++) {
    total += Adler32(1, code + page * 4096u, 4096u);
  }
  return total;
}

}  // namespace nimb::guest
