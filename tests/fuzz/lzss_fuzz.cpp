// Any bytes as an LZSS stream, decoded into a destination of a size that the
// first two bytes choose: the decoder must stay inside the input and the
// destination, and agree with the plain ring decoder byte for byte.
#include "fuzz_firmware.h"
#include "load/lzss.h"
#include "tests/unit/lzss_reference.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  if (size < 2)
    return 0;
  // Up to 64 KiB, so that the fast path runs as well as the careful one.
  const size_t capacity = data[0] | data[1] << 8;
  // Exact heap copies, so that a read or write past either end shows.
  const nimbtest::Bytes stream(data + 2, data + size);
  std::vector<uint8_t> destination(capacity);
  const UINT64 count =
      nimb::DecompressLzss(destination.data(), capacity, stream.data(), static_cast<UINT32>(stream.size()));
  const nimbtest::Bytes want = nimbtest::LzssReferenceDecode(stream, capacity);
  if (count != want.size() || (count != 0 && std::memcmp(destination.data(), want.data(), count) != 0))
    std::abort();
  return 0;
}
