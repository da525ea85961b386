// Any bytes as the preview section: the decoder must read nothing outside
// the section (it is copied into a buffer of exactly its size, which the
// sanitizer guards), write nothing outside the frame buffer, draw either
// everything or nothing, and give its working memory back.

#include "fuzz_firmware.h"
#include "screen/resume_display.h"

uint32_t Word(const std::vector<uint8_t> &bytes, size_t at) {
  uint32_t value = 0;
  if (bytes.size() >= at + 4)
    std::memcpy(&value, &bytes[at], 4);
  return value;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  static hostfw::Firmware fw;
  nimbfuzz::AttachLoader(fw);
  Check(fw.LivePoolBlocks() == 0);

  // The screen takes the picture's own size where that is small, so that
  // the runs are reached; otherwise a small screen that it doesn't fit.
  const std::vector<uint8_t> section(data, data + size);
  uint32_t bytes = Word(section, 0), width = Word(section, 4), height = Word(section, 8);
  if (bytes != 2 && bytes != 4)
    bytes = 4;
  if (width == 0 || width > 96 || height == 0 || height > 96) {
    width = 5;
    height = 3;
  }
  const uint32_t rowBytes = width * bytes + 8;
  std::vector<uint8_t> frame(static_cast<size_t>(rowBytes) * height + 8, 0xA5);
  const bool drawn = nimb::DrawResumePreview(section.data(), section.data() + section.size(), frame.data(),
                                             width, height, bytes, static_cast<INT32>(rowBytes));
  // Nothing but the picture's own bytes written.
  for (size_t i = 0; i < frame.size(); i++) {
    if (!drawn || i >= size_t(rowBytes) * height || i % rowBytes >= width * bytes)
      Check(frame[i] == 0xA5);
  }

  nimbfuzz::FinishInput(fw, false);
  return 0;
}
