#include "resume/preview_encoder.h"

#include <algorithm>
#include <map>

namespace previewenc {

namespace {

constexpr uint32_t kHeaderBytes = 12;
constexpr uint32_t kMaxRunCount = 0xFFFFFF;
constexpr uint32_t kRepeatKind = 1u << 24;

void Put32(std::vector<uint8_t> &out, uint32_t value) {
  for (int shift = 0; shift < 32; shift += 8)
    out.push_back(static_cast<uint8_t>(value >> shift));
}

void PutPixel(std::vector<uint8_t> &out, uint32_t pixel, uint32_t bytesPerPixel) {
  for (uint32_t i = 0; i < bytesPerPixel; i++)
    out.push_back(static_cast<uint8_t>(pixel >> (8 * i)));
}

// The runs of one row. A stretch of equal pixels becomes a repeat run when
// it is longer than what it costs to break a literal run for it (a control
// word on either side and one pixel).
std::vector<uint8_t> EncodeRow(const uint32_t *row, uint32_t width, uint32_t bytesPerPixel) {
  const uint32_t mask = bytesPerPixel == 2 ? 0xFFFF : 0xFFFFFFFF;
  const uint32_t minRepeat = (8 + bytesPerPixel) / bytesPerPixel + 1;
  std::vector<uint8_t> out;
  uint32_t literalStart = 0;
  auto flushLiteral = [&](uint32_t end) {
    while (literalStart < end) {
      const uint32_t count = std::min(end - literalStart, kMaxRunCount);
      Put32(out, count);
      for (uint32_t i = 0; i < count; i++)
        PutPixel(out, row[literalStart + i] & mask, bytesPerPixel);
      literalStart += count;
    }
  };
  for (uint32_t x = 0; x < width;) {
    uint32_t same = 1;
    while (x + same < width && (row[x + same] & mask) == (row[x] & mask) && same < kMaxRunCount)
      same++;
    if (same >= minRepeat) {
      flushLiteral(x);
      Put32(out, kRepeatKind | same);
      PutPixel(out, row[x] & mask, bytesPerPixel);
      x += same;
      literalStart = x;
    } else {
      x += same;
    }
  }
  flushLiteral(width);
  return out;
}

}  // namespace

std::vector<uint8_t> EncodePreview(const std::vector<uint32_t> &pixels, uint32_t width, uint32_t height,
                                   uint32_t bytesPerPixel, std::string *error) {
  if (bytesPerPixel != 2 && bytesPerPixel != 4) {
    *error = "bytes per pixel must be 2 or 4, not " + std::to_string(bytesPerPixel);
    return {};
  }
  if (width == 0 || height == 0) {
    *error = "a picture needs at least one pixel";
    return {};
  }
  if (pixels.size() != static_cast<uint64_t>(width) * height) {
    *error = std::to_string(pixels.size()) + " pixels for " + std::to_string(width) + " x " +
             std::to_string(height);
    return {};
  }
  std::vector<uint8_t> out;
  Put32(out, bytesPerPixel);
  Put32(out, width);
  Put32(out, height);
  out.resize(kHeaderBytes + 4 * static_cast<size_t>(height));
  std::map<std::vector<uint8_t>, uint32_t> placed;  // a row's runs and where they stand
  for (uint32_t y = 0; y < height; y++) {
    std::vector<uint8_t> runs =
        EncodeRow(pixels.data() + static_cast<size_t>(y) * width, width, bytesPerPixel);
    auto found = placed.find(runs);
    if (found == placed.end()) {
      if (out.size() > 0xFFFFFFFFu - runs.size()) {
        *error = "the picture does not fit 4 GiB";
        return {};
      }
      found = placed.emplace(std::move(runs), static_cast<uint32_t>(out.size())).first;
      out.insert(out.end(), found->first.begin(), found->first.end());
    }
    for (int shift = 0; shift < 32; shift += 8)
      out[kHeaderBytes + 4 * static_cast<size_t>(y) + shift / 8] =
          static_cast<uint8_t>(found->second >> shift);
  }
  return out;
}

}  // namespace previewenc
