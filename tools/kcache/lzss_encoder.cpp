#include "kcache/lzss_encoder.h"

#include <algorithm>

#include "load/lzss.h"

namespace kcache {

namespace {

constexpr uint32_t kRing = nimb::kLzssRingSize;
constexpr uint32_t kMinMatch = nimb::kLzssMinMatch;
constexpr uint32_t kMaxMatch = nimb::kLzssMaxMatch;
constexpr uint32_t kNone = 0xFFFFFFFF;
constexpr unsigned kHashBits = 15;
// The decoder copies a reference a word at a time from this distance on.
constexpr uint32_t kWordDistance = 8;

struct Match {
  uint8_t length;     // 0: none
  uint16_t distance;  // 1 .. 4096
};

// What the ring holds before the first byte, laid out as the 4096 bytes in
// front of the data: a reference reaching d bytes in front of the output
// reads ring position 4078 - d, a space for d up to 4078, else a zero.
std::vector<uint8_t> WithRingInFront(const uint8_t *data, size_t size) {
  std::vector<uint8_t> window(kRing + size);
  std::fill(window.begin(), window.begin() + (kRing - nimb::kLzssRingStart), 0);
  std::fill(window.begin() + (kRing - nimb::kLzssRingStart), window.begin() + kRing, ' ');
  std::copy(data, data + size, window.begin() + kRing);
  return window;
}

uint32_t Hash(const uint8_t *p) {
  const uint32_t bytes = static_cast<uint32_t>(p[0]) << 16 | static_cast<uint32_t>(p[1]) << 8 | p[2];
  return (bytes * 2654435761u) >> (32 - kHashBits);
}

// The longest match, up to 18 bytes, at every position of the data, by hash
// chains over the whole window. Of two equally long matches the nearer wins,
// unless it is too near for the decoder's word copies and the farther is not.
std::vector<Match> FindMatches(const std::vector<uint8_t> &window) {
  const uint32_t total = static_cast<uint32_t>(window.size());
  std::vector<uint32_t> head(1u << kHashBits, kNone);
  std::vector<uint32_t> previous(kRing, kNone);
  std::vector<Match> matches(total - kRing, Match{0, 0});
  auto insert = [&](uint32_t at) {
    const uint32_t h = Hash(&window[at]);
    previous[at & (kRing - 1)] = head[h];
    head[h] = at;
  };
  for (uint32_t at = 0; at < kRing && at + 2 < total; at++) {
    insert(at);
  }
  for (uint32_t at = kRing; at + kMinMatch <= total; at++) {
    const uint32_t most = std::min<uint32_t>(kMaxMatch, total - at);
    const uint8_t *here = &window[at];
    uint32_t best = 0, bestDistance = 0;
    for (uint32_t candidate = head[Hash(here)]; candidate != kNone && candidate + kRing >= at;
         candidate = previous[candidate & (kRing - 1)]) {
      const uint8_t *there = &window[candidate];
      const uint32_t distance = at - candidate;
      const bool sameButFarther =
          best >= kMinMatch && bestDistance < kWordDistance && distance >= kWordDistance;
      if (best >= kMinMatch && !sameButFarther && (best == most || there[best] != here[best])) {
        continue;  // cannot be longer
      }
      uint32_t length = 0;
      while (length < most && there[length] == here[length]) {
        length++;
      }
      if (length > best || (length == best && sameButFarther)) {
        best = length;
        bestDistance = distance;
        if (best == most && bestDistance >= kWordDistance) {
          break;
        }
      }
    }
    if (best >= kMinMatch) {
      matches[at - kRing] = Match{static_cast<uint8_t>(best), static_cast<uint16_t>(bestDistance)};
    }
    insert(at);
  }
  return matches;
}

// The length to take at each position: 0 for a literal.
std::vector<uint8_t> Parse(const std::vector<Match> &matches, LzssParse parse) {
  const size_t size = matches.size();
  std::vector<uint8_t> take(size, 0);
  if (parse == LzssParse::kGreedy) {
    for (size_t at = 0; at < size;) {
      take[at] = matches[at].length;
      at += take[at] == 0 ? 1 : take[at];
    }
    return take;
  }
  // Bits from each position to the end, flags included; on a tie the longer
  // step, which makes fewer items to decode.
  std::vector<uint64_t> cost(size + 1, 0);
  for (size_t at = size; at-- > 0;) {
    uint64_t best = 9 + cost[at + 1];
    uint8_t length = 0;
    for (uint32_t n = kMinMatch; n <= matches[at].length; n++) {
      if (17 + cost[at + n] <= best) {
        best = 17 + cost[at + n];
        length = static_cast<uint8_t>(n);
      }
    }
    cost[at] = best;
    take[at] = length;
  }
  return take;
}

}  // namespace

std::vector<uint8_t> CompressLzss(const uint8_t *data, size_t size, LzssParse parse) {
  const std::vector<uint8_t> window = WithRingInFront(data, size);
  const std::vector<Match> matches = FindMatches(window);
  const std::vector<uint8_t> take = Parse(matches, parse);

  std::vector<uint8_t> stream;
  stream.reserve(size + size / 8 + 16);
  size_t flagsAt = 0;
  unsigned items = 8;
  for (size_t at = 0; at < size;) {
    if (items == 8) {
      flagsAt = stream.size();
      stream.push_back(0);
      items = 0;
    }
    if (take[at] == 0) {
      stream[flagsAt] |= static_cast<uint8_t>(1u << items);
      stream.push_back(data[at]);
      at++;
    } else {
      // The ring position that lies `distance` behind the write position.
      const uint32_t position =
          static_cast<uint32_t>(nimb::kLzssRingStart + at - matches[at].distance) & (kRing - 1);
      stream.push_back(static_cast<uint8_t>(position));
      stream.push_back(static_cast<uint8_t>((position >> 4 & 0xF0) | (take[at] - kMinMatch)));
      at += take[at];
    }
    items++;
  }
  return stream;
}

}  // namespace kcache
