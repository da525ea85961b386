// The kernel cache's LZSS stream: fixed streams with known output and round
// trips through the cache writer's encoder (random streams against a plain
// ring decoder: the LZSS fuzz target).
#include "load/lzss.h"

#include <gtest/gtest.h>

#include <random>
#include <string>
#include <vector>

#include "kcache/lzss_encoder.h"

namespace {

using Bytes = std::vector<uint8_t>;

// Decodes into a destination of exactly `capacity` bytes (on the heap, so
// that a write past it shows) and returns what came out.
Bytes Decode(const Bytes &stream, size_t capacity) {
  Bytes destination(capacity);
  const UINT64 count =
      nimb::DecompressLzss(destination.data(), capacity, stream.data(), static_cast<UINT32>(stream.size()));
  EXPECT_LE(count, capacity);
  destination.resize(count);
  return destination;
}

TEST(LzssTest, FixedStreams) {
  struct Row {
    const char *name;
    Bytes stream;
    size_t capacity;
    std::string output;
  };
  const std::string zeros(3, '\0');
  const Row rows[] = {
      {"18 spaces from ring position 0", {0x00, 0x00, 0x0F}, 100, std::string(18, ' ')},
      {"a reference reading what it writes", {0x01, 'A', 0xEE, 0xF0}, 100, "AAAA"},
      {"cut after a reference's first byte", {0x01, 'A', 0xEE}, 100, "A"},
      {"a literal with no byte left", {0xFF}, 100, ""},
      {"the zeros behind the spaces", {0x00, 0xEE, 0xF0}, 100, zeros},
      {"spaces, then what it writes", {0x00, 0xEC, 0xF1}, 100, std::string(4, ' ')},
      {"across the ring's end", {0x00, 0xFF, 0xF0}, 100, std::string("\0  ", 3)},
      {"a reference cut by the destination", {0x00, 0x00, 0x0F}, 5, std::string(5, ' ')},
      {"a literal cut by the destination", {0x03, 'a', 'b', 0x00, 0x00}, 1, "a"},
      {"nothing", {}, 100, ""},
  };
  for (const Row &row : rows) {
    const Bytes out = Decode(row.stream, row.capacity);
    EXPECT_EQ(std::string(out.begin(), out.end()), row.output) << row.name;
  }
}

TEST(LzssTest, RoundTripsThroughTheEncoder) {
  std::mt19937 random(7);
  auto randomBytes = [&](size_t size, unsigned range) {
    Bytes bytes(size);
    for (uint8_t &byte : bytes)
      byte = static_cast<uint8_t>(random() % range);
    return bytes;
  };
  std::string text;
  while (text.size() < 30000)
    text +=
        "The loader reads the cache, decodes it and checks its sum. " + std::to_string(text.size()) + "\n";
  struct Row {
    const char *name;
    Bytes data;
  };
  std::vector<Row> rows = {
      {"empty", {}},
      {"spaces only", Bytes(5000, ' ')},
      {"zeros only", Bytes(70000, 0)},
      {"text", Bytes(text.begin(), text.end())},
  };
  for (size_t size : {1, 2, 17, 18, 19, 4077, 4078, 4079, 4095, 4096, 4097, 20000})
    rows.push_back({"random", randomBytes(size, 256)});
  for (size_t size : {19, 4078, 4097, 9000})
    rows.push_back({"four symbols", randomBytes(size, 4)});
  for (const Row &row : rows) {
    const Bytes optimal = kcache::CompressLzss(row.data.data(), row.data.size());
    const Bytes greedy = kcache::CompressLzss(row.data.data(), row.data.size(), kcache::LzssParse::kGreedy);
    EXPECT_EQ(Decode(optimal, row.data.size()), row.data) << row.name << " of " << row.data.size();
    EXPECT_EQ(Decode(greedy, row.data.size()), row.data) << row.name << " of " << row.data.size();
    // One flags byte more at most, from where the last group ends.
    EXPECT_LE(optimal.size(), greedy.size() + 1) << row.name << " of " << row.data.size();
  }
}

}  // namespace
