// AES decryption: the tables against the field arithmetic, the published
// vectors, and a random cross-check against OpenSSL, each through both the
// table path and the instructions path.
#include "resume/aes.h"

#include <gtest/gtest.h>
#include <openssl/evp.h>

#include <cstring>
#include <random>
#include <string>
#include <vector>

#include "resume/aes_tables.h"

namespace {

using Bytes = std::vector<UINT8>;

Bytes Hex(const std::string &text) {
  Bytes out;
  for (size_t i = 0; i + 1 < text.size(); i += 2)
    out.push_back(static_cast<UINT8>(std::stoul(text.substr(i, 2), nullptr, 16)));
  return out;
}

// Field arithmetic through logarithms to the generator 3, a route of its own
// beside the shift-and-reduce of the table generator.
struct Field {
  UINT8 exp[510], log[256];
  Field() {
    UINT8 x = 1;
    for (int i = 0; i < 255; i++) {
      exp[i] = exp[i + 255] = x;
      log[x] = static_cast<UINT8>(i);
      x = static_cast<UINT8>(x ^ (x << 1) ^ ((x & 0x80) ? 0x1B : 0));  // x * 3
    }
  }
  UINT8 Mul(UINT8 a, UINT8 b) const { return a && b ? exp[log[a] + log[b]] : 0; }
  UINT8 Sbox(UINT8 x) const {
    const UINT8 b = x ? exp[255 - log[x]] : 0;
    UINT8 out = 0;
    for (int bit = 0; bit < 8; bit++) {
      const int v = (b >> bit) ^ (b >> ((bit + 4) % 8)) ^ (b >> ((bit + 5) % 8)) ^ (b >> ((bit + 6) % 8)) ^
                    (b >> ((bit + 7) % 8)) ^ (0x63 >> bit);
      out |= static_cast<UINT8>((v & 1) << bit);
    }
    return out;
  }
  UINT32 Mix(UINT8 s) const {
    return Mul(s, 14) | Mul(s, 9) << 8 | Mul(s, 13) << 16 | static_cast<UINT32>(Mul(s, 11)) << 24;
  }
};

UINT32 Rotl(UINT32 w, int bits) {
  return bits ? (w << bits) | (w >> (32 - bits)) : w;
}

TEST(AesTablesTest, MatchTheFieldArithmetic) {
  const Field f;
  UINT8 inverseSbox[256];
  for (int x = 0; x < 256; x++)
    inverseSbox[f.Sbox(static_cast<UINT8>(x))] = static_cast<UINT8>(x);
  for (int k = 0; k < 4; k++) {
    for (int x = 0; x < 256; x++) {
      SCOPED_TRACE("sub-table " + std::to_string(k) + " entry " + std::to_string(x));
      EXPECT_EQ(nimb::kAesInverseRoundTable[k][x], Rotl(f.Mix(inverseSbox[x]), 8 * k));
      EXPECT_EQ(nimb::kAesInverseLastRoundTable[k][x], static_cast<UINT32>(inverseSbox[x]) << (8 * k));
      EXPECT_EQ(nimb::kAesForwardSboxTable[k][x], static_cast<UINT32>(f.Sbox(static_cast<UINT8>(x)))
                                                      << (8 * k));
      EXPECT_EQ(nimb::kAesInverseMixTable[k][x], Rotl(f.Mix(static_cast<UINT8>(x)), 8 * k));
    }
  }
  EXPECT_EQ(nimb::kAesInverseRoundTable[0][0], 0x50A7F451u);
  UINT8 rcon = 1;
  for (int i = 0; i < 10; i++, rcon = f.Mul(rcon, 2))
    EXPECT_EQ(nimb::kAesRoundConstants[i], rcon) << i;
}

// Runs each test once per path; the instructions path only where the
// processor has it.
class AesPathTest : public ::testing::TestWithParam<nimb::AesPath> {
 protected:
  void SetUp() override {
    saved_ = nimb::AesCurrentPath();
    if (nimb::AesSetPath(GetParam()) != GetParam())
      GTEST_SKIP() << "this processor has no AES instructions";
  }
  void TearDown() override { nimb::AesSetPath(saved_); }

 private:
  nimb::AesPath saved_ = nimb::kAesPathTables;
};

Bytes Decrypt(const Bytes &key, INT32 length, const Bytes &iv, const Bytes &cipher, bool inPlace) {
  nimb::AesDecryptContext context;
  nimb::AesExpandDecryptKey(key.data(), length, &context);
  const Bytes ivCopy = iv;
  Bytes out = cipher;
  const UINT32 blocks = static_cast<UINT32>(cipher.size() / 16);
  if (inPlace) {
    nimb::AesCbcDecrypt(out.data(), iv.data(), blocks, out.data(), &context);
  } else {
    std::fill(out.begin(), out.end(), 0xEE);
    nimb::AesCbcDecrypt(cipher.data(), iv.data(), blocks, out.data(), &context);
  }
  EXPECT_EQ(iv, ivCopy) << "the IV changed";
  return out;
}

TEST_P(AesPathTest, PublishedVectorsInPlaceAndApart) {
  struct Row {
    const char *source, *key, *iv, *plain, *cipher;
  };
  const std::string kPlain38A =
      "6bc1bee22e409f96e93d7e117393172aae2d8a571e03ac9c9eb76fac45af8e51"
      "30c81c46a35ce411e5fbc1191a0a52eff69f2445df4f9b17ad2b417be66c3710";
  const std::string kIv38A = "000102030405060708090a0b0c0d0e0f";
  const std::string kZeros = "00000000000000000000000000000000";
  const Row rows[] = {
      {"FIPS-197 C.1", "000102030405060708090a0b0c0d0e0f", kZeros.c_str(), "00112233445566778899aabbccddeeff",
       "69c4e0d86a7b0430d8cdb78070b4c55a"},
      {"FIPS-197 C.2", "000102030405060708090a0b0c0d0e0f1011121314151617", kZeros.c_str(),
       "00112233445566778899aabbccddeeff", "dda97ca4864cdfe06eaf70a0ec0d7191"},
      {"FIPS-197 C.3", "000102030405060708090a0b0c0d0e0f101112131415161718191a1b1c1d1e1f", kZeros.c_str(),
       "00112233445566778899aabbccddeeff", "8ea2b7ca516745bfeafc49904b496089"},
      {"SP 800-38A F.2.2", "2b7e151628aed2a6abf7158809cf4f3c", kIv38A.c_str(), kPlain38A.c_str(),
       "7649abac8119b246cee98e9b12e9197d5086cb9b507219ee95db113a917678b2"
       "73bed6b8e3c1743b7116e69e222295163ff1caa1681fac09120eca307586e1a7"},
      {"SP 800-38A F.2.4", "8e73b0f7da0e6452c810f32b809079e562f8ead2522c6b7b", kIv38A.c_str(),
       kPlain38A.c_str(),
       "4f021db243bc633d7178183a9fa071e8b4d9ada9ad7dedf4e5e738763f69145a"
       "571b242012fb7ae07fa9baac3df102e008b0e27988598881d920a9e64f5615cd"},
      {"SP 800-38A F.2.6", "603deb1015ca71be2b73aef0857d77811f352c073b6108d72d9810a30914dff4", kIv38A.c_str(),
       kPlain38A.c_str(),
       "f58c4c04d6e5f1ba779eabfb5f7bfbd69cfc4e967edb808d679f777bc6702c7d"
       "39f23369a9d9bacfa530e26304231461b2eb05e2c39be9fcda6c19078c6a9d1b"},
  };
  for (const Row &row : rows) {
    const Bytes key = Hex(row.key);
    const INT32 bytes = static_cast<INT32>(key.size());
    for (INT32 length : {bytes, bytes * 8}) {
      for (bool inPlace : {true, false}) {
        EXPECT_EQ(Decrypt(key, length, Hex(row.iv), Hex(row.cipher), inPlace), Hex(row.plain))
            << row.source << ", key length " << length << (inPlace ? ", in place" : ", apart");
      }
    }
  }
}

// OpenSSL's AES-CBC decryption without padding, the reference.
Bytes OpensslDecrypt(const Bytes &key, const Bytes &iv, const Bytes &cipher) {
  const EVP_CIPHER *type = key.size() == 16   ? EVP_aes_128_cbc()
                           : key.size() == 24 ? EVP_aes_192_cbc()
                                              : EVP_aes_256_cbc();
  EVP_CIPHER_CTX *context = EVP_CIPHER_CTX_new();
  Bytes out(cipher.size() + 16);
  int length = 0, tail = 0;
  EXPECT_EQ(EVP_DecryptInit_ex(context, type, nullptr, key.data(), iv.data()), 1);
  EVP_CIPHER_CTX_set_padding(context, 0);
  EXPECT_EQ(EVP_DecryptUpdate(context, out.data(), &length, cipher.data(), static_cast<int>(cipher.size())),
            1);
  EXPECT_EQ(EVP_DecryptFinal_ex(context, out.data() + length, &tail), 1);
  EVP_CIPHER_CTX_free(context);
  out.resize(static_cast<size_t>(length + tail));
  return out;
}

TEST_P(AesPathTest, RandomDataAgreesWithOpenssl) {
  std::mt19937 random(20261123);
  auto bytes = [&random](size_t n) {
    Bytes out(n);
    for (UINT8 &b : out)
      b = static_cast<UINT8>(random());
    return out;
  };
  // Block counts around the instructions path's groups of eight.
  const size_t kBlockCounts[] = {1, 2, 7, 8, 9, 15, 16, 17, 64, 203};
  for (int round = 0; round < 30; round++) {
    const size_t keySize = 16 + 8 * (round % 3);
    const size_t blocks = kBlockCounts[round % std::size(kBlockCounts)];
    const Bytes key = bytes(keySize), iv = bytes(16), cipher = bytes(16 * blocks);
    const Bytes want = OpensslDecrypt(key, iv, cipher);
    for (bool inPlace : {true, false})
      ASSERT_EQ(Decrypt(key, static_cast<INT32>(keySize), iv, cipher, inPlace), want)
          << keySize * 8 << "-bit key, " << blocks << " blocks" << (inPlace ? ", in place" : ", apart");
  }
}

TEST_P(AesPathTest, NoBlocksTouchNothing) {
  nimb::AesDecryptContext context;
  const Bytes key(16, 7);
  nimb::AesExpandDecryptKey(key.data(), 16, &context);
  Bytes out(32, 0x5A);
  nimb::AesCbcDecrypt(nullptr, nullptr, 0, out.data(), &context);
  EXPECT_EQ(out, Bytes(32, 0x5A));
}

INSTANTIATE_TEST_SUITE_P(BothPaths, AesPathTest,
                         ::testing::Values(nimb::kAesPathTables, nimb::kAesPathInstructions),
                         [](const ::testing::TestParamInfo<nimb::AesPath> &info) {
                           return std::string(info.param == nimb::kAesPathTables ? "Tables" : "Instructions");
                         });

TEST(AesTest, BothPathsGiveTheSameBytes) {
  const nimb::AesPath saved = nimb::AesCurrentPath();
  if (nimb::AesSetPath(nimb::kAesPathInstructions) != nimb::kAesPathInstructions)
    GTEST_SKIP() << "this processor has no AES instructions";
  Bytes cipher(16 * 1000);
  for (size_t i = 0; i < cipher.size(); i++)
    cipher[i] = static_cast<UINT8>(i * 131 + (i >> 8));
  const Bytes key(32, 0x3C), iv(16, 0xC3);
  const Bytes byInstructions = Decrypt(key, 256, iv, cipher, true);
  nimb::AesSetPath(nimb::kAesPathTables);
  EXPECT_EQ(Decrypt(key, 256, iv, cipher, true), byInstructions);
  nimb::AesSetPath(saved);
}

// xmm0 to xmm8, the registers the instructions path uses: read as they
// stand, or loaded with 0x5A.
__attribute__((target("sse2"))) void ReadVectorRegisters(UINT8 (*out)[16]) {
  __asm__ volatile(
      "movdqu %%xmm0, 0(%0)\n\tmovdqu %%xmm1, 16(%0)\n\tmovdqu %%xmm2, 32(%0)\n\t"
      "movdqu %%xmm3, 48(%0)\n\tmovdqu %%xmm4, 64(%0)\n\tmovdqu %%xmm5, 80(%0)\n\t"
      "movdqu %%xmm6, 96(%0)\n\tmovdqu %%xmm7, 112(%0)\n\tmovdqu %%xmm8, 128(%0)"
      :
      : "r"(out)
      : "memory");
}

__attribute__((target("sse2"))) void FillVectorRegisters() {
  static const Bytes pattern(16, 0x5A);
  __asm__ volatile(
      "movdqu (%0), %%xmm0\n\tmovdqa %%xmm0, %%xmm1\n\tmovdqa %%xmm0, %%xmm2\n\tmovdqa %%xmm0, %%xmm3\n\t"
      "movdqa %%xmm0, %%xmm4\n\tmovdqa %%xmm0, %%xmm5\n\tmovdqa %%xmm0, %%xmm6\n\tmovdqa %%xmm0, %%xmm7\n\t"
      "movdqa %%xmm0, %%xmm8"
      :
      : "r"(pattern.data())
      : "xmm0", "xmm1", "xmm2", "xmm3", "xmm4", "xmm5", "xmm6", "xmm7", "xmm8");
}

TEST(AesTest, TheInstructionsPathAndTheWipeLeaveTheVectorRegistersClear) {
  const nimb::AesPath saved = nimb::AesCurrentPath();
  if (nimb::AesSetPath(nimb::kAesPathInstructions) != nimb::kAesPathInstructions)
    GTEST_SKIP() << "this processor has no AES instructions";
  const Bytes key(32, 0x77), iv(16, 1), zeros(9 * 16, 0);
  Bytes data(16 * 9, 2);  // a group of eight and one block alone
  nimb::AesDecryptContext context;
  nimb::AesExpandDecryptKey(key.data(), 32, &context);
  UINT8 registers[9][16];
  nimb::AesCbcDecrypt(data.data(), iv.data(), 9, data.data(), &context);
  ReadVectorRegisters(registers);
  EXPECT_EQ(Bytes(&registers[0][0], &registers[0][0] + sizeof registers), zeros) << "after the decryption";
  FillVectorRegisters();
  nimb::AesWipe(&context);
  ReadVectorRegisters(registers);
  EXPECT_EQ(Bytes(&registers[0][0], &registers[0][0] + sizeof registers), zeros) << "after the wipe";
  nimb::AesSetPath(saved);
}

TEST(AesTest, UnknownKeyLengthsLeaveTheContextAlone) {
  const Bytes key(64, 0x11);
  for (INT32 length : {0, 20, 512, -16, 64, 129}) {
    nimb::AesDecryptContext context;
    std::memset(&context, 0xA5, sizeof context);
    nimb::AesExpandDecryptKey(key.data(), length, &context);
    EXPECT_EQ(Bytes(reinterpret_cast<UINT8 *>(&context), reinterpret_cast<UINT8 *>(&context + 1)),
              Bytes(sizeof context, 0xA5))
        << "key length " << length;
  }
}

TEST(AesTest, AContextThatNoKeyMadeDecryptsNothing) {
  nimb::AesDecryptContext context;
  std::memset(&context, 0, sizeof context);
  Bytes data(64, 0x5A);
  const Bytes iv(16, 0);
  for (UINT32 rounds : {0u, 11u, 16u, 0xFFFFFFFFu}) {
    context.rounds = rounds;
    nimb::AesCbcDecrypt(data.data(), iv.data(), 4, data.data(), &context);
    EXPECT_EQ(data, Bytes(64, 0x5A)) << rounds << " rounds";
  }
}

TEST(AesTest, ScheduleUsesOnlyItsWordsAndWipeClearsAll) {
  const Bytes key(32, 0x42);
  for (INT32 length : {16, 24, 32}) {
    nimb::AesDecryptContext context;
    std::memset(&context, 0xA5, sizeof context);
    nimb::AesExpandDecryptKey(key.data(), length, &context);
    const size_t used = 4 * (context.rounds + 1);
    EXPECT_EQ(context.rounds, static_cast<UINT32>(6 + length / 4));
    for (size_t i = used; i < 60; i++)
      EXPECT_EQ(context.schedule[i], 0xA5A5A5A5u) << "word " << i << " of a " << length << "-byte key";
    nimb::AesWipe(&context);
    EXPECT_EQ(Bytes(reinterpret_cast<UINT8 *>(&context), reinterpret_cast<UINT8 *>(&context + 1)),
              Bytes(sizeof context, 0));
  }
}

}  // namespace
