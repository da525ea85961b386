// preview_encode: the preview encoder as a program, for the resume image
// writer (tools/mkresume).
//
// Usage: preview_encode WIDTH HEIGHT BYTES_PER_PIXEL < pixels > picture
// The input is WIDTH x HEIGHT pixels, row by row, each a u32 little-endian;
// the output is the encoded picture. Exit status 1 on bad arguments.
#include <cstdio>
#include <cstdlib>
#include <string>
#include <vector>

#include "resume/preview_encoder.h"

int main(int argc, char **argv) {
  if (argc != 4) {
    std::fprintf(stderr, "Usage: preview_encode WIDTH HEIGHT BYTES_PER_PIXEL < pixels > picture\n");
    return 1;
  }
  const uint32_t width = static_cast<uint32_t>(std::strtoul(argv[1], nullptr, 10));
  const uint32_t height = static_cast<uint32_t>(std::strtoul(argv[2], nullptr, 10));
  const uint32_t bytesPerPixel = static_cast<uint32_t>(std::strtoul(argv[3], nullptr, 10));
  std::vector<uint32_t> pixels;
  uint8_t bytes[4];
  while (std::fread(bytes, 1, 4, stdin) == 4)
    pixels.push_back(bytes[0] | bytes[1] << 8 | bytes[2] << 16 | static_cast<uint32_t>(bytes[3]) << 24);
  std::string error;
  const std::vector<uint8_t> picture =
      previewenc::EncodePreview(pixels, width, height, bytesPerPixel, &error);
  if (picture.empty()) {
    std::fprintf(stderr, "preview_encode: %s\n", error.c_str());
    return 1;
  }
  return std::fwrite(picture.data(), 1, picture.size(), stdout) == picture.size() ? 0 : 1;
}
