#include "support/checksum.h"

#include "support/strings.h"

namespace nimb {

// --- Adler-32 -----------------------------------------------------------------

// The largest prime below 2^16.
static constexpr UINT32 kAdlerModulus = 65521;
// Bytes summed between two reductions. The sums are 64 bits wide: after a
// mebibyte of 0xFF they stay far below 2^64.
static constexpr UINT64 kAdlerChunk = 1 << 20;
// Bytes taken as one block of eight words, as sixteen-bit lanes of byte sums.
static constexpr UINT64 kAdlerBlock = 64;
// Every other byte of a word, as four sixteen-bit lanes.
static constexpr UINT64 kEvenBytes = 0x00FF00FF00FF00FFull;
// Multiplied by lanes, these put in the top lane their sum, or the sum
// weighted 7, 5, 3, 1 from the lowest lane up.
static constexpr UINT64 kLaneSum = 0x0001000100010001ull;
static constexpr UINT64 kLaneWeights = 0x0007000500030001ull;

typedef UINT64 __attribute__((aligned(1), may_alias)) UnalignedWord;

static UINT64 TopLane(UINT64 lanes, UINT64 factor) {
  return (lanes * factor) >> 48;
}

// A block of 64 bytes goes eight bytes a step: sixteen-bit lanes gather the
// sums of the bytes (P), of the even bytes (E) and of P before each step
// (Q), and fold into the two sums once per block. Over a block of n = 64
// bytes, s2 grows by n * s1 plus each byte times its distance from the
// block's end; a byte's distance is 8 for every later step plus 8 - its
// place in the word, which sums to 8 Q + E + P weighted 7, 5, 3, 1. No lane
// reaches 2^16 in eight steps, nor does any partial sum of the products.
// The standard checksum (s2 << 16 | s1) carried on over `length` more bytes.
static UINT32 Adler32Update(UINT32 adler, const void *data, UINT64 length) {
  const UINT8 *bytes = static_cast<const UINT8 *>(data);
  UINT64 s1 = adler & 0xFFFF;
  UINT64 s2 = adler >> 16;
  while (length > 0) {
    const UINT64 chunk = length < kAdlerChunk ? length : kAdlerChunk;
    const UINT8 *const end = bytes + chunk;
    for (; end - bytes >= static_cast<INT64>(kAdlerBlock); bytes += kAdlerBlock) {
      UINT64 p = 0, e = 0, q = 0;
#pragma clang loop unroll(full)
      for (UINTN i = 0; i < kAdlerBlock; i += 8) {
        const UINT64 word = *reinterpret_cast<const UnalignedWord *>(bytes + i);
        const UINT64 even = word & kEvenBytes;
        q += p;
        p += even + ((word >> 8) & kEvenBytes);
        e += even;
      }
      s2 += (s1 << 6) + (TopLane(q, kLaneSum) << 3) + TopLane(e, kLaneSum) + TopLane(p, kLaneWeights);
      s1 += TopLane(p, kLaneSum);
    }
    for (; bytes < end; bytes++) {
      s1 += *bytes;
      s2 += s1;
    }
    s1 %= kAdlerModulus;
    s2 %= kAdlerModulus;
    length -= chunk;
  }
  return static_cast<UINT32>(s2 << 16 | s1);
}

UINT32 Adler32(const void *data, UINT64 length) {
  const UINT32 sum = Adler32Update(1, data, length);
  return (sum >> 24) | ((sum >> 8) & 0xFF00) | ((sum << 8) & 0xFF0000) | (sum << 24);
}

// --- MD5 ----------------------------------------------------------------------

static UINT32 RotateLeft(UINT32 x, unsigned n) {
  return (x << n) | (x >> (32 - n));
}

static UINT32 F(UINT32 x, UINT32 y, UINT32 z) {
  return (x & y) | (~x & z);
}
static UINT32 G(UINT32 x, UINT32 y, UINT32 z) {
  return (x & z) | (y & ~z);
}
static UINT32 H(UINT32 x, UINT32 y, UINT32 z) {
  return x ^ y ^ z;
}
static UINT32 I(UINT32 x, UINT32 y, UINT32 z) {
  return y ^ (x | ~z);
}

// One step: a = b + ((a + f(b, c, d) + x + t) <<< s).
static void Step(UINT32 (*f)(UINT32, UINT32, UINT32), UINT32 &a, UINT32 b, UINT32 c, UINT32 d, UINT32 x,
                 unsigned s, UINT32 t) {
  a = b + RotateLeft(a + f(b, c, d) + x + t, s);
}

static void Encode(UINT8 *output, const UINT32 *input, UINTN length) {
  for (UINTN i = 0, j = 0; j < length; i++, j += 4) {
    output[j] = static_cast<UINT8>(input[i]);
    output[j + 1] = static_cast<UINT8>(input[i] >> 8);
    output[j + 2] = static_cast<UINT8>(input[i] >> 16);
    output[j + 3] = static_cast<UINT8>(input[i] >> 24);
  }
}

static void Decode(UINT32 *output, const UINT8 *input, UINTN length) {
  for (UINTN i = 0, j = 0; j < length; i++, j += 4) {
    output[i] = static_cast<UINT32>(input[j]) | (static_cast<UINT32>(input[j + 1]) << 8) |
                (static_cast<UINT32>(input[j + 2]) << 16) | (static_cast<UINT32>(input[j + 3]) << 24);
  }
}

void Md5Init(Md5Context *context) {
  context->count[0] = 0;
  context->count[1] = 0;
  context->state[0] = 0x67452301;
  context->state[1] = 0xEFCDAB89;
  context->state[2] = 0x98BADCFE;
  context->state[3] = 0x10325476;
}

void Md5Transform(UINT32 state[4], const UINT8 block[64]) {
  UINT32 a = state[0];
  UINT32 b = state[1];
  UINT32 c = state[2];
  UINT32 d = state[3];
  UINT32 x[16];
  Decode(x, block, 64);

  // Round 1
  Step(F, a, b, c, d, x[0], 7, 0xD76AA478);
  Step(F, d, a, b, c, x[1], 12, 0xE8C7B756);
  Step(F, c, d, a, b, x[2], 17, 0x242070DB);
  Step(F, b, c, d, a, x[3], 22, 0xC1BDCEEE);
  Step(F, a, b, c, d, x[4], 7, 0xF57C0FAF);
  Step(F, d, a, b, c, x[5], 12, 0x4787C62A);
  Step(F, c, d, a, b, x[6], 17, 0xA8304613);
  Step(F, b, c, d, a, x[7], 22, 0xFD469501);
  Step(F, a, b, c, d, x[8], 7, 0x698098D8);
  Step(F, d, a, b, c, x[9], 12, 0x8B44F7AF);
  Step(F, c, d, a, b, x[10], 17, 0xFFFF5BB1);
  Step(F, b, c, d, a, x[11], 22, 0x895CD7BE);
  Step(F, a, b, c, d, x[12], 7, 0x6B901122);
  Step(F, d, a, b, c, x[13], 12, 0xFD987193);
  Step(F, c, d, a, b, x[14], 17, 0xA679438E);
  Step(F, b, c, d, a, x[15], 22, 0x49B40821);

  // Round 2
  Step(G, a, b, c, d, x[1], 5, 0xF61E2562);
  Step(G, d, a, b, c, x[6], 9, 0xC040B340);
  Step(G, c, d, a, b, x[11], 14, 0x265E5A51);
  Step(G, b, c, d, a, x[0], 20, 0xE9B6C7AA);
  Step(G, a, b, c, d, x[5], 5, 0xD62F105D);
  Step(G, d, a, b, c, x[10], 9, 0x02441453);
  Step(G, c, d, a, b, x[15], 14, 0xD8A1E681);
  Step(G, b, c, d, a, x[4], 20, 0xE7D3FBC8);
  Step(G, a, b, c, d, x[9], 5, 0x21E1CDE6);
  Step(G, d, a, b, c, x[14], 9, 0xC33707D6);
  Step(G, c, d, a, b, x[3], 14, 0xF4D50D87);
  Step(G, b, c, d, a, x[8], 20, 0x455A14ED);
  Step(G, a, b, c, d, x[13], 5, 0xA9E3E905);
  Step(G, d, a, b, c, x[2], 9, 0xFCEFA3F8);
  Step(G, c, d, a, b, x[7], 14, 0x676F02D9);
  Step(G, b, c, d, a, x[12], 20, 0x8D2A4C8A);

  // Round 3
  Step(H, a, b, c, d, x[5], 4, 0xFFFA3942);
  Step(H, d, a, b, c, x[8], 11, 0x8771F681);
  Step(H, c, d, a, b, x[11], 16, 0x6D9D6122);
  Step(H, b, c, d, a, x[14], 23, 0xFDE5380C);
  Step(H, a, b, c, d, x[1], 4, 0xA4BEEA44);
  Step(H, d, a, b, c, x[4], 11, 0x4BDECFA9);
  Step(H, c, d, a, b, x[7], 16, 0xF6BB4B60);
  Step(H, b, c, d, a, x[10], 23, 0xBEBFBC70);
  Step(H, a, b, c, d, x[13], 4, 0x289B7EC6);
  Step(H, d, a, b, c, x[0], 11, 0xEAA127FA);
  Step(H, c, d, a, b, x[3], 16, 0xD4EF3085);
  Step(H, b, c, d, a, x[6], 23, 0x04881D05);
  Step(H, a, b, c, d, x[9], 4, 0xD9D4D039);
  Step(H, d, a, b, c, x[12], 11, 0xE6DB99E5);
  Step(H, c, d, a, b, x[15], 16, 0x1FA27CF8);
  Step(H, b, c, d, a, x[2], 23, 0xC4AC5665);

  // Round 4
  Step(I, a, b, c, d, x[0], 6, 0xF4292244);
  Step(I, d, a, b, c, x[7], 10, 0x432AFF97);
  Step(I, c, d, a, b, x[14], 15, 0xAB9423A7);
  Step(I, b, c, d, a, x[5], 21, 0xFC93A039);
  Step(I, a, b, c, d, x[12], 6, 0x655B59C3);
  Step(I, d, a, b, c, x[3], 10, 0x8F0CCC92);
  Step(I, c, d, a, b, x[10], 15, 0xFFEFF47D);
  Step(I, b, c, d, a, x[1], 21, 0x85845DD1);
  Step(I, a, b, c, d, x[8], 6, 0x6FA87E4F);
  Step(I, d, a, b, c, x[15], 10, 0xFE2CE6E0);
  Step(I, c, d, a, b, x[6], 15, 0xA3014314);
  Step(I, b, c, d, a, x[13], 21, 0x4E0811A1);
  Step(I, a, b, c, d, x[4], 6, 0xF7537E82);
  Step(I, d, a, b, c, x[11], 10, 0xBD3AF235);
  Step(I, c, d, a, b, x[2], 15, 0x2AD7D2BB);
  Step(I, b, c, d, a, x[9], 21, 0xEB86D391);

  state[0] += a;
  state[1] += b;
  state[2] += c;
  state[3] += d;

  // The block's words are sensitive; leave none of them on the stack.
  memset(x, 0, sizeof(x));
}

void Md5Update(Md5Context *context, const void *data, UINT32 length) {
  const UINT8 *input = static_cast<const UINT8 *>(data);
  UINT32 index = (context->count[0] >> 3) & 0x3F;

  // The bit count, as a 64-bit number in two words.
  context->count[0] += length << 3;
  if (context->count[0] < (length << 3)) {
    context->count[1]++;
  }
  context->count[1] += length >> 29;

  const UINT32 partLength = 64 - index;
  UINT32 i = 0;
  if (length >= partLength) {
    memcpy(&context->buffer[index], input, partLength);
    Md5Transform(context->state, context->buffer);
    for (i = partLength; length - i >= 64; i += 64) {
      Md5Transform(context->state, &input[i]);
    }
    index = 0;
  }
  memcpy(&context->buffer[index], &input[i], length - i);
}

void Md5Final(UINT8 digest[16], Md5Context *context) {
  static const UINT8 kPadding[64] = {0x80};

  UINT8 bits[8];
  Encode(bits, context->count, 8);

  // Pad to 56 bytes modulo 64, then append the length.
  const UINT32 index = (context->count[0] >> 3) & 0x3F;
  const UINT32 padLength = index < 56 ? 56 - index : 120 - index;
  Md5Update(context, kPadding, padLength);
  Md5Update(context, bits, 8);

  Encode(digest, context->state, 16);
  memset(context, 0, sizeof(*context));
}

}  // namespace nimb
