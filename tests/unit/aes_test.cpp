// AES decryption: published vectors and a random cross-check against
// OpenSSL, each through both the table path and the instructions path.
#include "resume/aes.h"

#include <gtest/gtest.h>

#include <cstring>
#include <random>
#include <string>
#include <vector>

#include "resume_scene.h"

namespace {

using Bytes = std::vector<UINT8>;

Bytes Hex(const std::string &text) {
  Bytes out;
  for (size_t i = 0; i + 1 < text.size(); i += 2)
    out.push_back(static_cast<UINT8>(std::stoul(text.substr(i, 2), nullptr, 16)));
  return out;
}

Bytes ContextBytes(const nimb::AesDecryptContext &context) {
  const auto *bytes = reinterpret_cast<const UINT8 *>(&context);
  return Bytes(bytes, bytes + sizeof context);
}

// Runs each test once per path; the instructions path only where the
// processor has it.
class AesPathTest : public ::testing::TestWithParam<nimb::AesPath> {
 protected:
  void SetUp() override {
    if (nimb::AesSetPath(GetParam()) != GetParam())
      GTEST_SKIP() << "this processor has no AES instructions";
  }
  void TearDown() override { nimb::AesSetPath(nimb::kAesPathInstructions); }
};

Bytes Decrypt(const Bytes &key, INT32 length, const Bytes &iv, const Bytes &cipher, bool inPlace) {
  nimb::AesDecryptContext context;
  nimb::AesExpandDecryptKey(key.data(), length, &context);
  const Bytes ivCopy = iv;
  Bytes out = cipher;
  const UINT32 blocks = static_cast<UINT32>(cipher.size() / 16);
  if (!inPlace)
    std::fill(out.begin(), out.end(), 0xEE);
  nimb::AesCbcDecrypt(inPlace ? out.data() : cipher.data(), iv.data(), blocks, out.data(), &context);
  EXPECT_EQ(iv, ivCopy) << "the IV changed";
  return out;
}

TEST_P(AesPathTest, PublishedVectorWithTheLengthInBytesAndBits) {
  const Bytes key = Hex("000102030405060708090a0b0c0d0e0f1011121314151617");
  for (INT32 length : {24, 192})
    EXPECT_EQ(Decrypt(key, length, Bytes(16, 0), Hex("dda97ca4864cdfe06eaf70a0ec0d7191"), true),
              Hex("00112233445566778899aabbccddeeff"))
        << length;
}

TEST_P(AesPathTest, RandomDataAgreesWithOpenssl) {
  std::mt19937 random(20261123);
  auto bytes = [&random](size_t n) {
    Bytes out(n);
    for (UINT8 &b : out)
      b = static_cast<UINT8>(random());
    return out;
  };
  // Block counts around the pairs of the tables and the instructions' groups of eight.
  const size_t kBlockCounts[] = {0, 1, 2, 7, 8, 9, 15, 16, 17, 64, 203};
  for (int round = 0; round < 33; round++) {
    const size_t keySize = 16 + 8 * (round % 3), blocks = kBlockCounts[round % std::size(kBlockCounts)];
    const Bytes key = bytes(keySize), iv = bytes(16), cipher = bytes(16 * blocks);
    const Bytes want = nimbtest::OpensslCbc(false, key, iv.data(), cipher);
    for (bool inPlace : {true, false})
      ASSERT_EQ(Decrypt(key, static_cast<INT32>(keySize), iv, cipher, inPlace), want)
          << keySize * 8 << "-bit key, " << blocks << " blocks" << (inPlace ? ", in place" : ", apart");
  }
}

INSTANTIATE_TEST_SUITE_P(BothPaths, AesPathTest,
                         ::testing::Values(nimb::kAesPathTables, nimb::kAesPathInstructions),
                         [](const ::testing::TestParamInfo<nimb::AesPath> &info) {
                           return std::string(info.param == nimb::kAesPathTables ? "Tables" : "Instructions");
                         });

// Only a known length makes a schedule, which uses only its own words and
// which the wipe clears; a context no key made decrypts nothing.
TEST(AesTest, ScheduleLengthsWipeAndContextsNoKeyMade) {
  const Bytes key(64, 0x42);
  for (INT32 length : {16, 24, 32, 0, 20, 512, -16, 64, 129}) {
    nimb::AesDecryptContext context;
    std::memset(&context, 0xA5, sizeof context);
    nimb::AesExpandDecryptKey(key.data(), length, &context);
    const UINT32 rounds = nimb::AesRoundsForKeyLength(length);
    if (rounds == 0) {
      EXPECT_EQ(ContextBytes(context), Bytes(sizeof context, 0xA5)) << length;
      continue;
    }
    EXPECT_EQ(context.rounds, static_cast<UINT32>(6 + length / 4));
    for (size_t i = 4 * (rounds + 1); i < 60; i++)
      EXPECT_EQ(context.schedule[i], 0xA5A5A5A5u) << "word " << i << " of a " << length << "-byte key";
    nimb::AesWipe(&context);
    EXPECT_EQ(ContextBytes(context), Bytes(sizeof context, 0));
  }
  nimb::AesDecryptContext context = {};
  Bytes data(64, 0x5A);
  for (UINT32 rounds : {0u, 11u, 16u, 0xFFFFFFFFu}) {
    context.rounds = rounds;
    nimb::AesCbcDecrypt(data.data(), data.data(), 4, data.data(), &context);
    EXPECT_EQ(data, Bytes(64, 0x5A)) << rounds << " rounds";
  }
}

}  // namespace
