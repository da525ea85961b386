// The LZSS encoder of the kernel cache writer: streams that the loader's
// DecompressLzss turns back into the same bytes.
#pragma once

#include <cstddef>
#include <cstdint>
#include <vector>

namespace kcache {

enum class LzssParse {
  // The longest match at every position, else a literal. Both parses see
  // every earlier position of the window that starts with the same three
  // bytes, so the matches they choose from are the longest there are.
  kGreedy,
  // The cheapest sequence of literals (9 bits) and references (17 bits) over
  // the longest match at every position, found backwards from the end.
  kOptimal,
};

// `size` must stay below 4 GiB - 4 KiB.
std::vector<uint8_t> CompressLzss(const uint8_t *data, size_t size, LzssParse parse = LzssParse::kOptimal);

}  // namespace kcache
