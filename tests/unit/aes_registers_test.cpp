// No key material stays in a processor register once the key's expansion or
// AesCbcDecrypt has returned, and the instructions path and the wipe leave
// the vector registers they use clear: a thunk fills the vector registers,
// makes the call and takes every general and vector register as the call
// left them, before any other code runs.
#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <set>

#include "resume/aes.h"

extern "C" {
struct RegisterDump {
  UINT64 general[15];  // rax rbx rcx rdx rsi rdi rbp r8 to r15
  UINT8 vector[16][16];
};
RegisterDump gAesRegisterDump;
const UINT8 *gAesIn;
UINT8 *gAesOut;
const UINT8 *gAesIv;
UINT32 gAesBlocks;
nimb::AesDecryptContext *gAesContext;
INT32 gAesKeyLength;  // above 0: the call is the key's expansion; below: the wipe

__attribute__((noinline, used)) void AesRegistersCall() {
  if (gAesKeyLength > 0)
    nimb::AesExpandDecryptKey(gAesIn, gAesKeyLength, gAesContext);
  else if (gAesKeyLength < 0)
    nimb::AesWipe(gAesContext);
  else
    nimb::AesCbcDecrypt(gAesIn, gAesIv, gAesBlocks, gAesOut, gAesContext);
}

#define DUMP_GENERAL(reg, n) "movq %" #reg ", gAesRegisterDump+8*" #n "(%rip)\n\t"
#define FILL_VECTOR(n) "pcmpeqb %xmm" #n ", %xmm" #n "\n\t"
#define DUMP_VECTOR(n) "movdqu %xmm" #n ", gAesRegisterDump+120+16*" #n "(%rip)\n\t"
__attribute__((naked)) void AesRegistersCallAndDump() {
  __asm__("pushq %rbx\n\t"  // clang-format off
      FILL_VECTOR(0) FILL_VECTOR(1) FILL_VECTOR(2) FILL_VECTOR(3) FILL_VECTOR(4) FILL_VECTOR(5)
      FILL_VECTOR(6) FILL_VECTOR(7) FILL_VECTOR(8)
      "call AesRegistersCall\n\t"
      DUMP_GENERAL(rax, 0) DUMP_GENERAL(rbx, 1) DUMP_GENERAL(rcx, 2) DUMP_GENERAL(rdx, 3)
      DUMP_GENERAL(rsi, 4) DUMP_GENERAL(rdi, 5) DUMP_GENERAL(rbp, 6) DUMP_GENERAL(r8, 7)
      DUMP_GENERAL(r9, 8) DUMP_GENERAL(r10, 9) DUMP_GENERAL(r11, 10) DUMP_GENERAL(r12, 11)
      DUMP_GENERAL(r13, 12) DUMP_GENERAL(r14, 13) DUMP_GENERAL(r15, 14)
      DUMP_VECTOR(0) DUMP_VECTOR(1) DUMP_VECTOR(2) DUMP_VECTOR(3) DUMP_VECTOR(4) DUMP_VECTOR(5)
      DUMP_VECTOR(6) DUMP_VECTOR(7) DUMP_VECTOR(8) DUMP_VECTOR(9) DUMP_VECTOR(10) DUMP_VECTOR(11)
      DUMP_VECTOR(12) DUMP_VECTOR(13) DUMP_VECTOR(14) DUMP_VECTOR(15)  // clang-format on
          "popq %rbx\n\t"
          "ret\n\t");
}
}

namespace {

// True when no 4-byte word of the register dump is one of `words`.
::testing::AssertionResult DumpHoldsNone(const std::set<UINT32> &words) {
  const UINT8 *bytes = reinterpret_cast<const UINT8 *>(&gAesRegisterDump);
  for (size_t at = 0; at + 4 <= sizeof gAesRegisterDump; at += 4) {
    UINT32 word;
    std::memcpy(&word, bytes + at, 4);
    if (words.count(word) != 0)
      return ::testing::AssertionFailure() << "a schedule word in the register dump at byte " << at;
  }
  return ::testing::AssertionSuccess();
}

// True when xmm0 to xmm8, the registers the instructions path uses, are clear.
bool VectorRegistersClear() {
  const UINT8 *bytes = &gAesRegisterDump.vector[0][0];
  return std::all_of(bytes, bytes + 9 * 16, [](UINT8 b) { return b == 0; });
}

TEST(AesRegisters, NoRoundKeyLeftInAnyRegisterByExpansionOrEitherPath) {
  UINT8 key[32];
  for (unsigned i = 0; i < sizeof key; i++)
    key[i] = static_cast<UINT8>(0x3C + 37 * i);
  UINT8 iv[16] = {}, data[16 * 9];
  std::memset(data, 0xA5, sizeof data);
  for (INT32 length : {16, 32}) {
    nimb::AesDecryptContext context;
    gAesIn = key, gAesKeyLength = length, gAesContext = &context;
    AesRegistersCallAndDump();
    gAesKeyLength = 0;
    // Every word of the schedule that could be told from noise.
    std::set<UINT32> words;
    for (UINT32 i = 0; i < 4 * (context.rounds + 1); i++)
      if (context.schedule[i] != 0 && context.schedule[i] != 0xFFFFFFFF)
        words.insert(context.schedule[i]);
    EXPECT_TRUE(DumpHoldsNone(words)) << "the expansion of a " << length << "-byte key";
    for (nimb::AesPath path : {nimb::kAesPathTables, nimb::kAesPathInstructions}) {
      if (nimb::AesSetPath(path) != path)
        continue;
      gAesIn = data, gAesOut = data, gAesIv = iv, gAesBlocks = 9, gAesContext = &context;
      AesRegistersCallAndDump();
      EXPECT_TRUE(DumpHoldsNone(words)) << "key length " << length << ", path " << path;
      if (path == nimb::kAesPathInstructions)
        EXPECT_TRUE(VectorRegistersClear()) << "after the decryption, key length " << length;
    }
    gAesKeyLength = -1;
    AesRegistersCallAndDump();
    EXPECT_TRUE(VectorRegistersClear()) << "after the wipe";
    gAesKeyLength = 0;
  }
  nimb::AesSetPath(nimb::kAesPathInstructions);
}

}  // namespace
