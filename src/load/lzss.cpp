#include "load/lzss.h"

namespace nimb {

// The decoder keeps no ring. The ring always holds the last 4096 bytes
// written, so a reference to ring position p, made when the write position
// is w, reads the output at the distance d = (w - p) mod 4096 behind it (0
// meaning 4096), and d stays the same for every byte of the reference. Only
// a distance reaching in front of the output's start reads the ring's first
// contents: spaces at positions 0 .. 4077, zeros at 4078 .. 4095.
//
// Every flags byte opens a group of eight items. A group runs on the fast
// path when it can neither reach in front of the output, nor run out of
// input, nor come near the destination's end: there a reference at a
// distance of 8 or more copies 24 bytes in three words whatever its count
// (the bytes behind it are written again by what follows), a nearer one goes
// byte by byte, and a run of literals moves as one word. Any other group
// takes the careful path, item by item with every bound checked. Groups on
// the fast path run in batches as long as the bounds hold for the worst
// case, and a flags byte of eight literals moves its eight bytes at once.

namespace {

typedef UINT64 __attribute__((aligned(1), may_alias)) UnalignedWord;

// Output of a group on the fast path: eight references of 18 bytes, the
// last copied as 24.
constexpr UINT64 kFastGroupOutput = 7 * kLzssMaxMatch + 24;
// Input of a group: its flags byte, eight references, and the word that a
// run of literals reads.
constexpr UINT64 kFastGroupInput = 1 + 8 * 2 + 8;
// What a group takes and gives at most: eight references.
constexpr UINT64 kMostGroupInput = 1 + 8 * 2;
constexpr UINT64 kMostGroupOutput = 8 * kLzssMaxMatch;

inline void CopyWord(UINT8 *to, const UINT8 *from) {
  *reinterpret_cast<UnalignedWord *>(to) = *reinterpret_cast<const UnalignedWord *>(from);
}

// The distance behind the output, 1 .. 4096, of ring position `position`
// when `written` bytes have been written.
inline UINT32 Distance(UINT64 written, UINT32 position) {
  return ((static_cast<UINT32>(written) + kLzssRingStart - 1 - position) & (kLzssRingSize - 1)) + 1;
}

}  // namespace

UINT64 DecompressLzss(UINT8 *destination, UINT64 capacity, const UINT8 *source, UINT32 length) {
  const UINT8 *const end = source + length;
  UINT8 *out = destination;
  UINT8 *const limit = destination + capacity;
  for (;;) {
    const UINT64 written = static_cast<UINT64>(out - destination);
    if (written >= kLzssRingSize && static_cast<UINT64>(limit - out) >= kFastGroupOutput &&
        static_cast<UINT64>(end - source) >= kFastGroupInput) {
      // As many groups as the bounds allow even if each took the most input
      // and gave the most output, without looking at the bounds again.
      UINT64 groups = static_cast<UINT64>(limit - out - kFastGroupOutput) / kMostGroupOutput;
      const UINT64 byInput = static_cast<UINT64>(end - source - kFastGroupInput) / kMostGroupInput;
      groups = (groups < byInput ? groups : byInput) + 1;
      do {
        UINT32 flags = *source++;
        if (flags == 0xFF) {
          // Eight literals: one word.
          CopyWord(out, source);
          out += 8;
          source += 8;
          continue;
        }
        // Literals in a row move as one word; the bytes behind the run are
        // written again by what follows.
        UINT32 items = 8;
        for (;;) {
          const UINT32 run = static_cast<UINT32>(__builtin_ctz(~flags));
          if (run != 0) {
            CopyWord(out, source);
            out += run;
            source += run;
            items -= run;
            if (items == 0) {
              break;
            }
            flags >>= run;
          }
          const UINT32 i = source[0], j = source[1];
          source += 2;
          const UINT32 count = (j & 0x0F) + kLzssMinMatch;
          const UINT32 distance = Distance(static_cast<UINT64>(out - destination), i | (j & 0xF0) << 4);
          const UINT8 *from = out - distance;
          if (distance >= 8) {
            CopyWord(out, from);
            CopyWord(out + 8, from + 8);
            CopyWord(out + 16, from + 16);
          } else {
            // A short period repeats what this reference is writing.
            for (UINT32 k = 0; k < count; k++) {
              out[k] = from[k];
            }
          }
          out += count;
          if (--items == 0) {
            break;
          }
          flags >>= 1;
        }
      } while (--groups != 0);
      continue;
    }

    // The careful path: one group, each item checked.
    if (source == end) {
      break;
    }
    UINT32 flags = *source++;
    for (UINT32 item = 0; item < 8; item++, flags >>= 1) {
      if (flags & 1) {
        if (source == end || out == limit) {
          return static_cast<UINT64>(out - destination);
        }
        *out++ = *source++;
        continue;
      }
      if (end - source < 2) {
        return static_cast<UINT64>(out - destination);
      }
      const UINT32 i = source[0], j = source[1];
      source += 2;
      const UINT32 position = i | (j & 0xF0) << 4;
      const UINT32 count = (j & 0x0F) + kLzssMinMatch;
      const UINT64 at = static_cast<UINT64>(out - destination);
      const UINT32 distance = Distance(at, position);
      for (UINT32 k = 0; k < count; k++) {
        if (out == limit) {
          return static_cast<UINT64>(out - destination);
        }
        if (at + k >= distance) {
          *out = out[-static_cast<INT64>(distance)];
        } else {
          // In front of the output: the ring's first contents.
          *out = ((position + k) & (kLzssRingSize - 1)) < kLzssRingStart ? ' ' : 0;
        }
        out++;
      }
    }
  }
  return static_cast<UINT64>(out - destination);
}

}  // namespace nimb
