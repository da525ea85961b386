// Arbitrary bytes through the text conversions, SPrint's %a and strtoul,
// with output buffers of exactly the size given, so that AddressSanitizer
// sees any write past them.
//
// Input: two bytes of output size, one of unit limit, one of base and byte
// order, then the text.

#include "fuzz_firmware.h"
#include "support/sprint.h"
#include "support/strings.h"
#include "support/text.h"

// Exactly `size` bytes on the heap, however many that is.
struct ExactBuffer {
  explicit ExactBuffer(size_t size) : bytes(new uint8_t[size]), size(size) {}
  std::unique_ptr<uint8_t[]> bytes;
  size_t size;
  template <typename T>
  T *As() {
    return reinterpret_cast<T *>(bytes.get());
  }
};

// The text up to its first NUL, in a buffer of exactly its length + 1.
ExactBuffer Terminated(const uint8_t *data, size_t size) {
  const size_t length = strnlen(reinterpret_cast<const char *>(data), size);
  ExactBuffer text(length + 1);
  memcpy(text.bytes.get(), data, length);
  text.bytes[length] = 0;
  return text;
}

// Decodes into a buffer large enough for anything; returns the units
// written, the terminator included if there was one. (An over-long form of
// NUL gives a zero unit too, so only the caller can tell.)
std::vector<UINT16> Decode(const uint8_t *text, UINT64 maxUnits) {
  std::vector<UINT16> units(strlen(reinterpret_cast<const char *>(text)) + 1);
  UINT64 count = 0;
  nimb::Utf8ToUcs(text, maxUnits, units.data(), &count, 2 * units.size());
  Check(count <= units.size());
  units.resize(count);
  return units;
}

void CheckUtf8ToUcs(const uint8_t *data, size_t size, UINT64 maxUnits, size_t outBytes) {
  ExactBuffer text = Terminated(data, size);
  ExactBuffer out(outBytes);
  UINT64 count = ~0ULL;
  nimb::Utf8ToUcs(text.bytes.get(), maxUnits, out.As<UINT16>(), &count, outBytes);
  Check(2 * count <= outBytes);
  Check(count == 0 || count - 1 <= maxUnits);
  Check(outBytes < 2 || maxUnits != 0 || count == 1);

  // A prefix of what a buffer large enough gives, and at most a terminator
  // behind it.
  const std::vector<UINT16> full = Decode(text.bytes.get(), maxUnits);
  const UINT16 *units = out.As<UINT16>();
  for (UINT64 i = 0; i < count; i++) {
    const bool terminator = i == count - 1 && units[i] == 0;
    Check(terminator || (i < full.size() && units[i] == full[i]));
  }
}

size_t EncodedLength(UINT16 unit) {
  return unit < 0x80 ? 1 : unit < 0x800 ? 2 : 3;
}

void CheckUcsToUtf8(const uint8_t *data, size_t size, bool swapped, size_t outBytes) {
  const INT32 units = static_cast<INT32>(size / 2);
  ExactBuffer source(2 * units);
  memcpy(source.bytes.get(), data, 2 * units);
  ExactBuffer out(outBytes);
  nimb::UcsToUtf8(source.As<UINT16>(), units, out.bytes.get(), static_cast<UINT32>(outBytes),
                  swapped ? 2 : 1);
  if (outBytes == 0)
    return;

  const size_t length = strnlen(reinterpret_cast<const char *>(out.bytes.get()), outBytes);
  Check(length < outBytes);  // a terminator

  // The output decodes back to the non-zero units, in order, up to the
  // first one that did not fit.
  std::vector<UINT16> expected;
  for (INT32 i = 0; i < units; i++) {
    UINT16 unit = static_cast<UINT16>(data[2 * i] | data[2 * i + 1] << 8);
    if (swapped)
      unit = static_cast<UINT16>(unit >> 8 | unit << 8);
    if (unit != 0)
      expected.push_back(unit);
  }
  std::vector<UINT16> decoded = Decode(out.bytes.get(), ~0ULL);
  Check(!decoded.empty() && decoded.back() == 0);
  decoded.pop_back();
  Check(decoded.size() <= expected.size());
  Check(std::equal(decoded.begin(), decoded.end(), expected.begin()));
  // The next character would have fitted, terminator included.
  Check(decoded.size() >= expected.size() || length + EncodedLength(expected[decoded.size()]) >= outBytes);
}

void CheckSPrint(const uint8_t *data, size_t size, size_t outBytes) {
  ExactBuffer text = Terminated(data, size);
  const size_t length = text.size - 1;
  ExactBuffer out(outBytes);
  CHAR16 *buffer = out.As<CHAR16>();
  const UINTN written = nimb::SPrint(buffer, outBytes, u"%a", text.bytes.get());
  if (outBytes < 2) {
    Check(written == 0);
    return;
  }
  const size_t kept = std::min(length, outBytes / 2 - 1);
  Check(written == kept + 1 && buffer[kept] == 0);
  for (size_t i = 0; i < kept; i++) {
    Check(buffer[i] == text.bytes[i]);
  }
}

void CheckStrtoul(const uint8_t *data, size_t size, INT32 base) {
  ExactBuffer text = Terminated(data, size);
  const char *start = text.As<char>();
  char *end = nullptr;
  const UINT64 value = nimb::strtoul(start, &end, base);
  Check(end >= start && end <= start + (text.size - 1));
  Check(end != start || value == 0);
  Check(nimb::strtoul(start, nullptr, base) == value);
}

// The value is the first `maxUnits` bytes of a longer text: converting it in
// place must give what converting a copy of just those bytes gives, and a
// terminated text either way.
void CheckUtf8ToUcsAlloc(const uint8_t *data, size_t size, UINT64 maxUnits) {
  ExactBuffer text = Terminated(data, size);
  const CHAR16 *converted = nimb::Utf8ToUcsAlloc(text.As<char>(), maxUnits);
  Check(converted != nullptr);
  const size_t bufferUnits = (4 * (text.size - 1) + 2) / 2;
  size_t length = 0;
  while (length < bufferUnits && converted[length] != 0)
    length++;
  Check(length < bufferUnits);

  const size_t valueBytes = std::min<size_t>(maxUnits, text.size - 1);
  ExactBuffer value(valueBytes + 1);
  memcpy(value.bytes.get(), text.bytes.get(), valueBytes);
  value.bytes[valueBytes] = 0;
  std::vector<UINT16> expected = Decode(value.bytes.get(), maxUnits);
  // The terminator, or an over-long form of NUL, ends the text as a string.
  expected.erase(std::find(expected.begin(), expected.end(), 0), expected.end());
  Check(length == expected.size());
  for (size_t i = 0; i < length; i++) {
    Check(converted[i] == expected[i]);
  }
  nimb::TrackedFreeAll();
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  if (size < 4)
    return 0;
  static hostfw::Firmware &fw = *new hostfw::Firmware;
  nimbfuzz::AttachLoader(fw);
  const size_t outBytes = (data[0] | data[1] << 8) % 600;
  const UINT64 maxUnits = data[2] == 0xFF ? ~0ULL : data[2];
  const INT32 base = data[3] % 40;
  const bool swapped = (data[3] & 0x80) != 0;
  data += 4;
  size -= 4;

  CheckUtf8ToUcs(data, size, maxUnits, outBytes);
  CheckUcsToUtf8(data, size, swapped, outBytes);
  CheckSPrint(data, size, outBytes);
  CheckStrtoul(data, size, base);
  CheckUtf8ToUcsAlloc(data, size, maxUnits);
  return 0;
}
