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

// --- the table path ---------------------------------------------------------------
//
// New column c of a round is the XOR of the inverse round table's sub-table
// 0 at byte 0 of column c, sub-table 1 at byte 1 of column c + 3, sub-table
// 2 at byte 2 of column c + 2, sub-table 3 at byte 3 of column c + 1
// (InvShiftRows), and the round key. The code walks it the other way round:
// each old column hands its four bytes to four new columns.
//
// Two blocks run side by side (CBC decryption has no chain between blocks),
// so that one block's work fills the other's waits for its table loads.
// All of it is one assembly routine with every register fixed, so that no
// state, key word or pointer of a round goes through the stack:
//
//   eax ebx ecx edx   the state of the round at work, whose bytes are taken
//                     apart with the second-byte registers (movzbl %ah):
//                     5 operations a column, the fewest x86 allows
//   r8d-r11d          block A between its rounds
//   r12d-r15d         block B between its rounds
//   rsi               the table; rdi the schedule + 128, so that every
//                     round key lies within an 8-bit displacement; ebp the
//                     index
//
// A round moves a block's state into eax to edx (register moves, which the
// processor does without an execution unit) and leaves the new state in
// the block's own registers.
//
// The rounds are unrolled from round 13 down: a 128-bit key enters at
// round 9, a 192-bit key at round 11, a 256-bit key at round 13, the entry
// chosen once per call. Before it returns the routine clears every general
// register it used, so that no key or state word stays behind.

// What the routine takes, in one record: one pointer argument under either
// build's calling convention.
struct TableJob {
  const UINT8 *input;
  UINT8 *output;
  const UINT8 *iv;
  const UINT32 *schedule;
  const UINT32 (*roundTable)[256];
  const UINT32 (*lastRoundTable)[256];
  UINT64 blockCount;
  UINT64 rounds;
};
static_assert(__builtin_offsetof(TableJob, input) == 0 && __builtin_offsetof(TableJob, output) == 8 &&
                  __builtin_offsetof(TableJob, iv) == 16 && __builtin_offsetof(TableJob, schedule) == 24 &&
                  __builtin_offsetof(TableJob, roundTable) == 32 &&
                  __builtin_offsetof(TableJob, lastRoundTable) == 40 &&
                  __builtin_offsetof(TableJob, blockCount) == 48 &&
                  __builtin_offsetof(TableJob, rounds) == 56,
              "the assembly reads the record at these offsets");

// clang-format off
// The four words of round r's key into four registers.
#define AES_KEY(r, d0, d1, d2, d3)                   \
  "movl 16*" #r "-128(%rdi), %" d0 "\n\t"            \
  "movl 16*" #r "-124(%rdi), %" d1 "\n\t"            \
  "movl 16*" #r "-120(%rdi), %" d2 "\n\t"            \
  "movl 16*" #r "-116(%rdi), %" d3 "\n\t"
// One old column (word w, its low byte l and second byte h) to the new
// columns d0 to d3.
#define AES_FROM_P(w, l, h, d0, d1, d2, d3)          \
  "movzbl %" l ", %ebp\n\t"                          \
  "xorl (%rsi,%rbp,4), %" d0 "\n\t"                  \
  "movzbl %" h ", %ebp\n\t"                          \
  "xorl 1024(%rsi,%rbp,4), %" d1 "\n\t"              \
  "shrl $16, %" w "\n\t"                             \
  "movzbl %" l ", %ebp\n\t"                          \
  "xorl 2048(%rsi,%rbp,4), %" d2 "\n\t"              \
  "movzbl %" h ", %ebp\n\t"                          \
  "xorl 3072(%rsi,%rbp,4), %" d3 "\n\t"
// Round r of the state in eax to edx into the registers d0 to d3.
#define AES_ROUND_P(r, d0, d1, d2, d3)               \
  AES_KEY(r, d0 "d", d1 "d", d2 "d", d3 "d")         \
  AES_FROM_P("eax", "al", "ah", d0 "d", d1 "d", d2 "d", d3 "d") \
  AES_FROM_P("ebx", "bl", "bh", d1 "d", d2 "d", d3 "d", d0 "d") \
  AES_FROM_P("ecx", "cl", "ch", d2 "d", d3 "d", d0 "d", d1 "d") \
  AES_FROM_P("edx", "dl", "dh", d3 "d", d0 "d", d1 "d", d2 "d")
// Round r of both blocks.
#define AES_ROUND(r)                                 \
  "movl %r8d, %eax\n\t" "movl %r9d, %ebx\n\t" "movl %r10d, %ecx\n\t" "movl %r11d, %edx\n\t" \
  AES_ROUND_P(r, "r8", "r9", "r10", "r11")           \
  "movl %r12d, %eax\n\t" "movl %r13d, %ebx\n\t" "movl %r14d, %ecx\n\t" "movl %r15d, %edx\n\t" \
  AES_ROUND_P(r, "r12", "r13", "r14", "r15")
// Four words at `address` XORed into a set, and the set stored at `to`.
#define AES_XOR_WORDS(address, d0, d1, d2, d3)       \
  "xorl 0(" address "), %" d0 "\n\t"                 \
  "xorl 4(" address "), %" d1 "\n\t"                 \
  "xorl 8(" address "), %" d2 "\n\t"                 \
  "xorl 12(" address "), %" d3 "\n\t"
#define AES_STORE_WORDS(to, d0, d1, d2, d3)          \
  "movl %" d0 ", 0(" to ")\n\t"                      \
  "movl %" d1 ", 4(" to ")\n\t"                      \
  "movl %" d2 ", 8(" to ")\n\t"                      \
  "movl %" d3 ", 12(" to ")\n\t"
#define AES_LOAD_WORDS(from, d0, d1, d2, d3)         \
  "movl 0(" from "), %" d0 "\n\t"                    \
  "movl 4(" from "), %" d1 "\n\t"                    \
  "movl 8(" from "), %" d2 "\n\t"                    \
  "movl 12(" from "), %" d3 "\n\t"
#define AES_BLOCK_A "r8d", "r9d", "r10d", "r11d"
#define AES_BLOCK_B "r12d", "r13d", "r14d", "r15d"
// A macro applied to an address and a set.
#define AES_WORDS(macro, address, ...) macro(address, __VA_ARGS__)

// The whole CBC walk from the last block to the first, two blocks a pass:
// A is block a and B block a + 1. B chains to A's ciphertext and A to block
// a - 1's (or the IV), which both stay in place until the pass stores its
// plaintext. With an odd count, block 0 is left for a last pass in which A
// and B are both block 0, each chained to the IV: the two halves store the
// same plaintext.
//
// The frame: 0 the job, 8 the blocks still to do, 16 the entry round, 24
// and 32 the chaining values of A and B, 40 and 48 their output blocks, 56
// the last round's key.
__attribute__((naked, ms_abi)) void DecryptWithTables(const TableJob *) {
  __asm__(
      "pushq %rbx\n\t" "pushq %rbp\n\t" "pushq %rdi\n\t" "pushq %rsi\n\t"
      "pushq %r12\n\t" "pushq %r13\n\t" "pushq %r14\n\t" "pushq %r15\n\t"
      "subq $64, %rsp\n\t"
      "movq %rcx, 0(%rsp)\n\t"
      "movq 48(%rcx), %rax\n\t"
      "testq %rax, %rax\n\t"
      "jz .Laes_tables_done\n\t"
      "movq %rax, 8(%rsp)\n\t"
      "movq 56(%rcx), %rax\n\t"
      "movq %rax, %rdx\n\t"
      "shlq $4, %rdx\n\t"
      "addq 24(%rcx), %rdx\n\t"
      "movq %rdx, 56(%rsp)\n\t"
      "leaq .Laes_tables_from13(%rip), %rdx\n\t"
      "leaq .Laes_tables_from11(%rip), %r8\n\t"
      "leaq .Laes_tables_from9(%rip), %r9\n\t"
      "cmpq $12, %rax\n\t"
      "cmoveq %r8, %rdx\n\t"
      "cmovbq %r9, %rdx\n\t"
      "movq %rdx, 16(%rsp)\n"
      ".Laes_tables_pair:\n\t"
      "movq 0(%rsp), %rcx\n\t"
      "movq 8(%rsp), %rax\n\t"
      "movq 0(%rcx), %r9\n\t"
      "movq 8(%rcx), %r10\n\t"
      "movq 16(%rcx), %r11\n\t"
      "cmpq $2, %rax\n\t"
      "jae .Laes_tables_two\n\t"
      "movq $0, 8(%rsp)\n\t"
      "movq %r9, %r14\n\t"
      "movq %r9, %r15\n\t"
      "movq %r11, 24(%rsp)\n\t"
      "movq %r11, 32(%rsp)\n\t"
      "movq %r10, 40(%rsp)\n\t"
      "movq %r10, 48(%rsp)\n\t"
      "jmp .Laes_tables_load\n"
      ".Laes_tables_two:\n\t"
      "subq $2, %rax\n\t"
      "movq %rax, 8(%rsp)\n\t"
      "shlq $4, %rax\n\t"
      "leaq (%r9,%rax), %r14\n\t"
      "leaq 16(%r14), %r15\n\t"
      "movq %r14, 32(%rsp)\n\t"
      "leaq -16(%r14), %r8\n\t"
      "testq %rax, %rax\n\t"
      "cmoveq %r11, %r8\n\t"
      "movq %r8, 24(%rsp)\n\t"
      "addq %r10, %rax\n\t"
      "movq %rax, 40(%rsp)\n\t"
      "addq $16, %rax\n\t"
      "movq %rax, 48(%rsp)\n"
      ".Laes_tables_load:\n\t"
      "movq 32(%rcx), %rsi\n\t"
      "movq 24(%rcx), %rdi\n\t"
      "addq $128, %rdi\n\t"
      "movq 56(%rsp), %rbp\n\t"
      AES_WORDS(AES_LOAD_WORDS, "%r14", AES_BLOCK_A)
      AES_WORDS(AES_XOR_WORDS, "%rbp", AES_BLOCK_A)
      AES_WORDS(AES_LOAD_WORDS, "%r15", AES_BLOCK_B)
      AES_WORDS(AES_XOR_WORDS, "%rbp", AES_BLOCK_B)
      "jmpq *16(%rsp)\n"
      ".Laes_tables_from13:\n\t"
      AES_ROUND(13) AES_ROUND(12)
      ".Laes_tables_from11:\n\t"
      AES_ROUND(11) AES_ROUND(10)
      ".Laes_tables_from9:\n\t"
      AES_ROUND(9) AES_ROUND(8) AES_ROUND(7) AES_ROUND(6) AES_ROUND(5)
      AES_ROUND(4) AES_ROUND(3) AES_ROUND(2) AES_ROUND(1)
      "movq 0(%rsp), %rsi\n\t"
      "movq 40(%rsi), %rsi\n\t"
      AES_ROUND(0)
      // Both blocks chained, then stored.
      "movq 32(%rsp), %rsi\n\t"
      AES_WORDS(AES_XOR_WORDS, "%rsi", AES_BLOCK_B)
      "movq 24(%rsp), %rsi\n\t"
      AES_WORDS(AES_XOR_WORDS, "%rsi", AES_BLOCK_A)
      "movq 48(%rsp), %rdi\n\t"
      AES_WORDS(AES_STORE_WORDS, "%rdi", AES_BLOCK_B)
      "movq 40(%rsp), %rdi\n\t"
      AES_WORDS(AES_STORE_WORDS, "%rdi", AES_BLOCK_A)
      "cmpq $0, 8(%rsp)\n\t"
      "jne .Laes_tables_pair\n"
      ".Laes_tables_done:\n\t"
      "xorl %eax, %eax\n\t" "xorl %ebx, %ebx\n\t" "xorl %ecx, %ecx\n\t" "xorl %edx, %edx\n\t"
      "xorl %esi, %esi\n\t" "xorl %edi, %edi\n\t" "xorl %ebp, %ebp\n\t"
      "xorl %r8d, %r8d\n\t" "xorl %r9d, %r9d\n\t" "xorl %r10d, %r10d\n\t" "xorl %r11d, %r11d\n\t"
      "xorl %r12d, %r12d\n\t" "xorl %r13d, %r13d\n\t" "xorl %r14d, %r14d\n\t" "xorl %r15d, %r15d\n\t"
      "addq $64, %rsp\n\t"
      "popq %r15\n\t" "popq %r14\n\t" "popq %r13\n\t" "popq %r12\n\t"
      "popq %rsi\n\t" "popq %rdi\n\t" "popq %rbp\n\t" "popq %rbx\n\t"
      "retq");
}
// clang-format on

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
    const TableJob job = {
        input,      output, iv, context->schedule, kAesInverseRoundTable, kAesInverseLastRoundTable,
        blockCount, rounds};
    DecryptWithTables(&job);
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
