#include "resume/aes.h"

#include "resume/aes_tables.h"
#include "support/strings.h"

namespace nimb {

namespace {

AesPath gAesPath;  // 0 until the first use

// Words in memory at any alignment (x86 reads them as they stand).
typedef UINT32 __attribute__((aligned(1), may_alias)) UnalignedWord;

inline UINT32 Byte(UINT32 word, unsigned n) {
  return (word >> (8 * n)) & 0xFF;
}

inline UINT32 LoadWord(const UINT8 *bytes) {
  return *reinterpret_cast<const UnalignedWord *>(bytes);
}

// One word through a table block: the XOR of the entries of its four bytes.
inline UINT32 ThroughTable(const UINT32 (*table)[256], UINT32 word) {
  return table[0][Byte(word, 0)] ^ table[1][Byte(word, 1)] ^ table[2][Byte(word, 2)] ^
         table[3][Byte(word, 3)];
}

// A round of decryption, in assembly so that the state stays in the four
// registers whose second byte x86 can address (movzbl %ah): five operations
// take a word apart into its four table indexes.
//
// New column c is the XOR of the inverse round table's sub-table 0 at byte 0
// of column c, sub-table 1 at byte 1 of column c + 3, sub-table 2 at byte 2
// of column c + 2, sub-table 3 at byte 3 of column c + 1 (InvShiftRows), and
// the round key. The code walks it the other way round: each old column
// hands its four bytes to four new columns. Round `round`'s key lies at
// byte 16 x round of the schedule.
// clang-format off
#define AES_FROM(s, a, b, c, d, table)               \
  "movzbl %b[" s "], %%esi\n\t"                      \
  "movzbl %h[" s "], %%edi\n\t"                      \
  "xorl (%[" table "],%%rsi,4), %[" a "]\n\t"        \
  "xorl 1024(%[" table "],%%rdi,4), %[" b "]\n\t"    \
  "shrl $16, %[" s "]\n\t"                           \
  "movzbl %b[" s "], %%esi\n\t"                      \
  "movzbl %h[" s "], %%edi\n\t"                      \
  "xorl 2048(%[" table "],%%rsi,4), %[" c "]\n\t"    \
  "xorl 3072(%[" table "],%%rdi,4), %[" d "]\n\t"
#define AES_ROUND(round, table)                      \
  "movl 16*" #round "+0(%[k]), %[n0]\n\t"           \
  "movl 16*" #round "+4(%[k]), %[n1]\n\t"           \
  "movl 16*" #round "+8(%[k]), %[n2]\n\t"           \
  "movl 16*" #round "+12(%[k]), %[n3]\n\t"          \
  AES_FROM("s0", "n0", "n1", "n2", "n3", table)      \
  AES_FROM("s1", "n1", "n2", "n3", "n0", table)      \
  AES_FROM("s2", "n2", "n3", "n0", "n1", table)      \
  AES_FROM("s3", "n3", "n0", "n1", "n2", table)      \
  "movl %[n0], %[s0]\n\t"                           \
  "movl %[n1], %[s1]\n\t"                           \
  "movl %[n2], %[s2]\n\t"                           \
  "movl %[n3], %[s3]\n\t"
// One round of the state (x0, x1, x2, x3).
#define AES_ONE_ROUND(round, table, x0, x1, x2, x3)                                       \
  __asm__(AES_ROUND(round, table)                                                         \
          : [s0] "+a"(x0), [s1] "+b"(x1), [s2] "+c"(x2), [s3] "+d"(x3),                   \
            [n0] "=&r"(n0), [n1] "=&r"(n1), [n2] "=&r"(n2), [n3] "=&r"(n3)                \
          : [k] "r"(schedule), [t] "r"(kAesInverseRoundTable), [l] "r"(kAesInverseLastRoundTable) \
          : "rsi", "rdi", "cc", "memory")
// clang-format on

// Block `i` of `input` through the tables into block `i` of `output`, and
// with `kPair` block i + 1 beside it: the two blocks' rounds alternate, so
// that one runs while the other waits for its table loads. The four
// registers of the round are the first block's; the compiler moves the
// second block's state in and out around each of its rounds.
//
// The ten rounds of a 128-bit key are unrolled; a 192-bit key has two more
// in front, a 256-bit key four.
template <bool kPair>
__attribute__((always_inline)) inline void DecryptBlocks(const UINT8 *input, const UINT8 *iv, UINTN i,
                                                         UINT8 *output, const UINT32 *schedule,
                                                         UINT32 rounds) {
  const UINT8 *block = input + 16 * i;
  const UINT32 *k = schedule + 4 * rounds;
  UINT32 a0 = LoadWord(block) ^ k[0], a1 = LoadWord(block + 4) ^ k[1], a2 = LoadWord(block + 8) ^ k[2],
         a3 = LoadWord(block + 12) ^ k[3];
  UINT32 b0 = 0, b1 = 0, b2 = 0, b3 = 0;
  if (kPair) {
    b0 = LoadWord(block + 16) ^ k[0];
    b1 = LoadWord(block + 20) ^ k[1];
    b2 = LoadWord(block + 24) ^ k[2];
    b3 = LoadWord(block + 28) ^ k[3];
  }
  UINT32 n0, n1, n2, n3;
#define AES_STEP(round, table)                   \
  AES_ONE_ROUND(round, table, a0, a1, a2, a3);   \
  if (kPair) {                                   \
    AES_ONE_ROUND(round, table, b0, b1, b2, b3); \
  }
  if (rounds > 10) {
    if (rounds > 12) {
      AES_STEP(13, "t");
      AES_STEP(12, "t");
    }
    AES_STEP(11, "t");
    AES_STEP(10, "t");
  }
  AES_STEP(9, "t");
  AES_STEP(8, "t");
  AES_STEP(7, "t");
  AES_STEP(6, "t");
  AES_STEP(5, "t");
  AES_STEP(4, "t");
  AES_STEP(3, "t");
  AES_STEP(2, "t");
  AES_STEP(1, "t");
  AES_STEP(0, "l");
#undef AES_STEP
  // Block i + 1 chains to block i, which is stored over only after it; block
  // i chains to block i - 1 of the input, still intact: it comes next.
  UnalignedWord *out = reinterpret_cast<UnalignedWord *>(output + 16 * i);
  if (kPair) {
    out[4] = b0 ^ LoadWord(block);
    out[5] = b1 ^ LoadWord(block + 4);
    out[6] = b2 ^ LoadWord(block + 8);
    out[7] = b3 ^ LoadWord(block + 12);
  }
  const UINT8 *chain = i != 0 ? block - 16 : iv;
  out[0] = a0 ^ LoadWord(chain);
  out[1] = a1 ^ LoadWord(chain + 4);
  out[2] = a2 ^ LoadWord(chain + 8);
  out[3] = a3 ^ LoadWord(chain + 12);
}

// Two blocks at a time from the end; with an odd count, block 0 alone last.
void DecryptWithTables(const UINT8 *input, const UINT8 *iv, UINT32 blockCount, UINT8 *output,
                       const AesDecryptContext *context) {
  UINTN i = blockCount;
  for (; i >= 2; i -= 2) {
    DecryptBlocks<true>(input, iv, i - 2, output, context->schedule, context->rounds);
  }
  if (i == 1) {
    DecryptBlocks<false>(input, iv, 0, output, context->schedule, context->rounds);
  }
}

// --- the instructions path -------------------------------------------------------
//
// The schedule's bytes in memory are the round keys in the order aesdec
// takes them: round 0 at `schedule`, the last round 16 x rounds bytes
// further. Only xmm0 to xmm8 are used; every one of them is cleared before
// the assembly ends, and the firmware's own xmm6 to xmm8 (kept by the callee
// under its calling convention) are saved and restored by the compiler.
// Outside these functions the loader is built without SSE.

// clang-format off
#define AES_XMM(op, n) op " %%xmm8, %%xmm" #n "\n\t"
#define AES_ALL8(op)                                                                  \
  AES_XMM(op, 0) AES_XMM(op, 1) AES_XMM(op, 2) AES_XMM(op, 3)                         \
  AES_XMM(op, 4) AES_XMM(op, 5) AES_XMM(op, 6) AES_XMM(op, 7)
// Output block n of the group: the chaining value is input block n - 1.
#define AES_CHAIN(n, previous)                                                        \
  "movdqu " #previous "(%[in]), %%xmm8\n\t"                                           \
  "pxor %%xmm8, %%xmm" #n "\n\t"                                                      \
  "movdqu %%xmm" #n ", " #n "*16(%[out])\n\t"
#define AES_CLEAR(n) "pxor %%xmm" #n ", %%xmm" #n "\n\t"
#define AES_CLEAR_ALL                                                                 \
  AES_CLEAR(0) AES_CLEAR(1) AES_CLEAR(2) AES_CLEAR(3) AES_CLEAR(4)                    \
  AES_CLEAR(5) AES_CLEAR(6) AES_CLEAR(7) AES_CLEAR(8)
#define AES_REGISTERS "xmm0", "xmm1", "xmm2", "xmm3", "xmm4", "xmm5", "xmm6", "xmm7", "xmm8"
// clang-format on

// Eight blocks at `in` side by side, so that the instructions' latency is
// hidden. `chain` is the chaining value of the first of them.
__attribute__((target("aes,sse2"))) void DecryptEight(const UINT8 *in, const UINT8 *chain, UINT8 *out,
                                                      const UINT8 *first, const UINT8 *last) {
  const UINT8 *key;
  __asm__ volatile(
      "movdqu 0*16(%[in]), %%xmm0\n\t"
      "movdqu 1*16(%[in]), %%xmm1\n\t"
      "movdqu 2*16(%[in]), %%xmm2\n\t"
      "movdqu 3*16(%[in]), %%xmm3\n\t"
      "movdqu 4*16(%[in]), %%xmm4\n\t"
      "movdqu 5*16(%[in]), %%xmm5\n\t"
      "movdqu 6*16(%[in]), %%xmm6\n\t"
      "movdqu 7*16(%[in]), %%xmm7\n\t"
      "movdqu (%[last]), %%xmm8\n\t" AES_ALL8("pxor")
      "lea -16(%[last]), %[key]\n"
      "1:\n\t"
      "movdqu (%[key]), %%xmm8\n\t" AES_ALL8("aesdec")
      "sub $16, %[key]\n\t"
      "cmp %[first], %[key]\n\t"
      "jne 1b\n\t"
      "movdqu (%[first]), %%xmm8\n\t" AES_ALL8("aesdeclast")
      // From the top down: a block's chaining value is stored over only
      // after it has been read.
      AES_CHAIN(7, 6*16) AES_CHAIN(6, 5*16) AES_CHAIN(5, 4*16) AES_CHAIN(4, 3*16) AES_CHAIN(3, 2*16)
      AES_CHAIN(2, 1*16) AES_CHAIN(1, 0*16)
      "movdqu (%[chain]), %%xmm8\n\t"
      "pxor %%xmm8, %%xmm0\n\t"
      "movdqu %%xmm0, (%[out])\n\t" AES_CLEAR_ALL
      : [key] "=&r"(key)
      : [in] "r"(in), [out] "r"(out), [chain] "r"(chain), [first] "r"(first), [last] "r"(last)
      : AES_REGISTERS, "cc", "memory");
}

__attribute__((target("aes,sse2"))) void DecryptOne(const UINT8 *in, const UINT8 *chain, UINT8 *out,
                                                    const UINT8 *first, const UINT8 *last) {
  const UINT8 *key;
  __asm__ volatile(
      "movdqu (%[in]), %%xmm0\n\t"
      "movdqu (%[last]), %%xmm8\n\t"
      "pxor %%xmm8, %%xmm0\n\t"
      "lea -16(%[last]), %[key]\n"
      "1:\n\t"
      "movdqu (%[key]), %%xmm8\n\t"
      "aesdec %%xmm8, %%xmm0\n\t"
      "sub $16, %[key]\n\t"
      "cmp %[first], %[key]\n\t"
      "jne 1b\n\t"
      "movdqu (%[first]), %%xmm8\n\t"
      "aesdeclast %%xmm8, %%xmm0\n\t"
      "movdqu (%[chain]), %%xmm8\n\t"
      "pxor %%xmm8, %%xmm0\n\t"
      "movdqu %%xmm0, (%[out])\n\t" AES_CLEAR(0) AES_CLEAR(8)
      : [key] "=&r"(key)
      : [in] "r"(in), [out] "r"(out), [chain] "r"(chain), [first] "r"(first), [last] "r"(last)
      : "xmm0", "xmm8", "cc", "memory");
}

// The same walk as the tables' path, eight blocks at a time from the end;
// the first blockCount mod 8 blocks go one by one.
void DecryptWithInstructions(const UINT8 *input, const UINT8 *iv, UINT32 blockCount, UINT8 *output,
                             const AesDecryptContext *context) {
  const UINT8 *first = reinterpret_cast<const UINT8 *>(context->schedule);
  const UINT8 *last = first + 16 * context->rounds;
  UINTN i = blockCount;
  for (; i >= 8; i -= 8) {
    const UINTN group = i - 8;
    const UINT8 *in = input + 16 * group;
    DecryptEight(in, group != 0 ? in - 16 : iv, output + 16 * group, first, last);
  }
  while (i-- > 0) {
    const UINT8 *in = input + 16 * i;
    DecryptOne(in, i != 0 ? in - 16 : iv, output + 16 * i, first, last);
  }
}

__attribute__((target("sse2"))) void ClearVectorRegisters() {
  __asm__ volatile(AES_CLEAR_ALL ::: AES_REGISTERS);
}

bool ProcessorHasAesInstructions() {
  UINT32 a = 1, b, c = 0, d;
  __asm__ volatile("cpuid" : "+a"(a), "=b"(b), "+c"(c), "=d"(d));
  const UINT32 kEcxAes = 1u << 25, kEdxSse2 = 1u << 26;
  return (c & kEcxAes) != 0 && (d & kEdxSse2) != 0;
}

// The standard expansion for a key of `keyWords` words, then every word of
// the rounds between the first and the last through InvMixColumns. Behind
// it stand the three key sizes.
void ExpandKey(const UINT8 *key, UINT32 keyWords, UINT32 rounds, AesDecryptContext *context) {
  UINT32 *w = context->schedule;
  const UINT32 words = 4 * (rounds + 1);
  for (UINT32 i = 0; i < keyWords; i++) {
    w[i] = LoadWord(key + 4 * i);
  }
  for (UINT32 i = keyWords; i < words; i++) {
    UINT32 t = w[i - 1];
    if (i % keyWords == 0) {
      // SubWord(RotWord(t)): byte n of the result comes from byte n + 1.
      t = kAesForwardSboxTable[0][Byte(t, 1)] ^ kAesForwardSboxTable[1][Byte(t, 2)] ^
          kAesForwardSboxTable[2][Byte(t, 3)] ^ kAesForwardSboxTable[3][Byte(t, 0)] ^
          kAesRoundConstants[i / keyWords - 1];
    } else if (keyWords == 8 && i % 8 == 4) {
      t = ThroughTable(kAesForwardSboxTable, t);
    }
    w[i] = w[i - keyWords] ^ t;
  }
  for (UINT32 i = 4; i < 4 * rounds; i++) {
    w[i] = ThroughTable(kAesInverseMixTable, w[i]);
  }
  context->rounds = rounds;
}

}  // namespace

UINT32 AesRoundsForKeyLength(INT32 keyLength) {
  switch (keyLength) {
    case 16:
    case 128:
      return 10;
    case 24:
    case 192:
      return 12;
    case 32:
    case 256:
      return 14;
    default:
      return 0;
  }
}

void AesExpandDecryptKey(const UINT8 *key, INT32 keyLength, AesDecryptContext *context) {
  // 4 key words for 10 rounds, 6 for 12, 8 for 14.
  const UINT32 rounds = AesRoundsForKeyLength(keyLength);
  if (rounds != 0) {
    ExpandKey(key, rounds - 6, rounds, context);
  }
}

void AesCbcDecrypt(const UINT8 *input, const UINT8 *iv, UINT32 blockCount, UINT8 *output,
                   const AesDecryptContext *context) {
  // A context that no key length made would send the walk outside it.
  const UINT32 rounds = context->rounds;
  if (rounds != 10 && rounds != 12 && rounds != 14) {
    return;
  }
  if (AesCurrentPath() == kAesPathInstructions) {
    DecryptWithInstructions(input, iv, blockCount, output, context);
  } else {
    DecryptWithTables(input, iv, blockCount, output, context);
  }
}

void AesWipe(AesDecryptContext *context) {
  bzero(context, sizeof *context);
  // Keeps the zeroing: the context is dead to the compiler after this.
  __asm__ volatile("" : : "r"(context) : "memory");
  if (gAesPath == kAesPathInstructions) {
    ClearVectorRegisters();
  }
}

AesPath AesCurrentPath() {
  if (gAesPath == 0) {
    gAesPath = ProcessorHasAesInstructions() ? kAesPathInstructions : kAesPathTables;
  }
  return gAesPath;
}

AesPath AesSetPath(AesPath path) {
  gAesPath =
      path == kAesPathInstructions && ProcessorHasAesInstructions() ? kAesPathInstructions : kAesPathTables;
  return gAesPath;
}

}  // namespace nimb
