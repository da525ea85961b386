// UTF-8 <-> UCS-2. Only the 16-bit range has a form here: four-byte UTF-8
// is malformed, and surrogate units travel as three-byte forms of their own.
#include "support/text.h"

#include "memory/tracking.h"
#include "support/strings.h"

namespace nimb {

namespace {

// Units are read byte by byte, low byte first: a source may be a device
// tree value at any address.
inline UINT16 ReadUnit(const UINT16 *source, INT32 index, bool swapped) {
  const UINT8 *bytes = reinterpret_cast<const UINT8 *>(source) + 2 * static_cast<UINTN>(index);
  return swapped ? static_cast<UINT16>(bytes[0] << 8 | bytes[1])
                 : static_cast<UINT16>(bytes[1] << 8 | bytes[0]);
}

// Decodes UTF-8 until a NUL or `sourceBytes` bytes of input (a byte past that
// limit reads as a NUL), `maxUnits` units, or a buffer of `destinationBytes`
// with room left only for the terminator. Returns false when malformed input
// stopped it, in which case no terminator was written.
bool DecodeUtf8(const UINT8 *source, UINT64 sourceBytes, UINT64 maxUnits, UINT16 *destination,
                UINT64 *unitCount, UINT64 destinationBytes) {
  *unitCount = 0;
  if (destinationBytes < 2) {
    return true;  // not even room for the terminator
  }
  UINT64 count = 0;
  UINT64 at = 0;
  auto byteAt = [&](UINT64 index) -> UINT8 { return index < sourceBytes ? source[index] : 0; };
  for (;;) {
    const UINT8 lead = byteAt(at);
    if (lead == 0 || count >= maxUnits || 2 * count + 4 > destinationBytes) {
      destination[count++] = 0;
      *unitCount = count;
      return true;
    }
    UINT32 unit;
    UINT32 following;
    switch (lead >> 4) {
      case 0xC:
      case 0xD:
        unit = lead & 0x1F;
        following = 1;
        break;
      case 0xE:
        unit = lead & 0x0F;
        following = 2;
        break;
      default:
        if (lead >= 0x80) {
          *unitCount = count;
          return false;
        }
        unit = lead;
        following = 0;
        break;
    }
    at++;
    for (UINT32 i = 0; i < following; i++) {
      const UINT8 next = byteAt(at);
      if ((next & 0xC0) != 0x80) {
        // A NUL here fails the test too, so nothing past the text is read.
        *unitCount = count;
        return false;
      }
      unit = unit << 6 | (next & 0x3F);
      at++;
    }
    destination[count++] = static_cast<UINT16>(unit);
  }
}

}  // namespace

void UcsToUtf8(const UINT16 *source, INT32 units, UINT8 *destination, UINT32 destinationSize,
               UINT32 byteOrder) {
  if (destinationSize == 0) {
    return;
  }
  const bool swapped = byteOrder == 2;
  // Positions are offsets; `last` is the byte kept for the terminator.
  const UINT64 last = destinationSize - 1;
  UINT64 at = 0;
  for (INT32 i = 0; i < units; i++) {
    const UINT16 unit = ReadUnit(source, i, swapped);
    const UINT64 extra = unit < 0x80 ? 0 : unit < 0x800 ? 1 : 2;
    if (at + extra >= last) {
      break;  // the whole character or nothing
    }
    if (unit == 0) {
      continue;
    }
    if (unit < 0x80) {
      destination[at++] = static_cast<UINT8>(unit);
    } else if (unit < 0x800) {
      destination[at++] = static_cast<UINT8>(0xC0 | unit >> 6);
      destination[at++] = static_cast<UINT8>(0x80 | (unit & 0x3F));
    } else {
      destination[at++] = static_cast<UINT8>(0xE0 | unit >> 12);
      destination[at++] = static_cast<UINT8>(0x80 | ((unit >> 6) & 0x3F));
      destination[at++] = static_cast<UINT8>(0x80 | (unit & 0x3F));
    }
  }
  destination[at] = 0;
}

void Utf8ToUcs(const UINT8 *source, UINT64 maxUnits, UINT16 *destination, UINT64 *unitCount,
               UINT64 destinationBytes) {
  DecodeUtf8(source, ~0ULL, maxUnits, destination, unitCount, destinationBytes);
}

char *UcsToUtf8Alloc(const CHAR16 *text) {
  const UINT64 units = StrLen(text);
  const UINT64 size = 3 * units + 1;
  UINT8 *buffer = static_cast<UINT8 *>(TrackedAllocatePool(size));
  if (buffer == nullptr) {
    return nullptr;
  }
  UcsToUtf8(reinterpret_cast<const UINT16 *>(text), static_cast<INT32>(units), buffer,
            static_cast<UINT32>(size), 1);
  return reinterpret_cast<char *>(buffer);
}

CHAR16 *Utf8ToUcsAlloc(const char *text, UINT64 maxUnits) {
  const UINT64 size = 4 * static_cast<UINT64>(strlen(text)) + 2;
  UINT16 *buffer = static_cast<UINT16 *>(TrackedAllocatePool(size));
  if (buffer == nullptr) {
    return nullptr;
  }
  // `maxUnits` is the value's length in bytes when the value sits inside a
  // longer string, so the input is cut there as well: the result never runs
  // into what follows, whatever characters the value holds. Malformed input
  // still leaves a terminated text; each unit took at least one byte, so the
  // terminator has room.
  UINT64 count;
  if (!DecodeUtf8(reinterpret_cast<const UINT8 *>(text), maxUnits, maxUnits, buffer, &count, size)) {
    buffer[count] = 0;
  }
  return reinterpret_cast<CHAR16 *>(buffer);
}

}  // namespace nimb
