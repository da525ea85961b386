// The resume display: the progress bar's first drawing and repaints against
// a model of the cell mask, and the preview decoder against a plain
// two-dimensional blur of pictures made by the preview encoder.
#include "screen/resume_display.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <string>
#include <vector>

#include "loader_fixture.h"
#include "resume/preview_encoder.h"

namespace {

constexpr UINT32 kWidth = 640, kHeight = 480;
constexpr UINT32 kBarLeft = (kWidth - 190) / 2, kBarTop = kHeight - 97;

// The cell mask as the bar is specified: rows 0 and 15 and the outer columns
// blend, the rest is opaque.
UINT32 Mask(UINT32 i) {
  static const UINT8 top[7] = {0, 99, 216, 240, 216, 99, 0}, bottom[7] = {0, 102, 219, 243, 219, 102, 0};
  static const UINT8 side[16] = {0, 81, 174, 195, 195, 195, 195, 195, 195, 195, 195, 195, 195, 174, 84, 0};
  const UINT32 y = i / 7, x = i % 7;
  return y == 0 ? top[x] : y == 15 ? bottom[x] : x == 0 || x == 6 ? side[y] : 255;
}

UINT32 Grey(UINT32 level, UINT32 depth) {
  const UINT32 w = level >> 3;
  return depth == 16 ? w | w << 5 | w << 10 : level | level << 8 | level << 16;
}

// The 8-bit level a pixel stands for, as the save table keeps it.
UINT8 Level(UINT32 pixel, UINT32 depth) {
  const UINT32 x = pixel & 0x1F;
  return static_cast<UINT8>(depth == 16 ? x * 8 | x >> 2 : pixel & 0xFF);
}

class ResumeBarTest : public nimbtest::LoaderTest, public ::testing::WithParamInterface<UINT32> {
 protected:
  void SetUp() override {
    LoaderTest::SetUp();
    depth_ = GetParam();
    fw.AddScreen({kWidth, kHeight, depth_});
    ASSERT_EQ(nimb::InitConsole(), EFI_SUCCESS);
  }

  // Writes a different grey under every pixel of the bar, then has the
  // background fill fail, so that the first drawing finds that pattern.
  void PatternUnderTheBar() {
    UINT8 *base = reinterpret_cast<UINT8 *>(fw.ScreenFacts().base);
    const UINT32 bytes = depth_ / 8, rowBytes = fw.ScreenFacts().rowBytes;
    for (UINT32 y = kBarTop; y < kBarTop + 16; y++) {
      for (UINT32 x = kBarLeft; x < kBarLeft + 190; x++) {
        const UINT32 pixel = Grey((x * 7 + y * 29) & 0xFF, depth_);
        std::memcpy(base + y * rowBytes + x * bytes, &pixel, bytes);
      }
    }
    fw.FailCall("UgaBlt");
  }

  // The bar's pixels, cell by cell, row by row.
  std::vector<UINT32> Cell(UINT32 n) {
    std::vector<UINT32> out;
    for (UINT32 y = 0; y < 16; y++)
      for (UINT32 x = 0; x < 7; x++)
        out.push_back(fw.ScreenPixel(kBarLeft + 10 * n + x, kBarTop + y));
    return out;
  }

  // What cell `n` shows at `level` over the backgrounds `under` (pixels as
  // Cell gives them before the drawing), blended with the shift of the
  // first drawing or the division of a repaint; the samples it saves.
  std::vector<UINT32> Expected(const std::vector<UINT32> &under, UINT32 level, bool repaint,
                               std::vector<UINT8> *samples = nullptr) {
    std::vector<UINT32> out = under;
    for (UINT32 i = 0; i < out.size(); i++) {
      const UINT32 a = Mask(i);
      if (a == 255) {
        out[i] = Grey(level, depth_);
      } else if (a != 0) {
        const UINT32 bg = Level(under[i], depth_), sum = (255 - a) * bg + a * level + 255;
        out[i] = Grey(repaint ? sum / 255 : sum >> 8, depth_);
        if (samples != nullptr)
          samples->push_back(static_cast<UINT8>(bg));
      }
    }
    return out;
  }

  UINT32 depth_ = 32;
};

TEST_P(ResumeBarTest, FirstDrawingSavesInMaskOrderAndRepaintsReplayTheSamples) {
  PatternUnderTheBar();
  std::vector<std::vector<UINT32>> under;
  for (UINT32 n = 0; n < 19; n++)
    under.push_back(Cell(n));
  std::vector<UINT8> table(nimb::kProgressSaveTableBytes + 8, 0xEE);
  nimb::DrawResumeScreen(nullptr, nullptr, table.data());

  std::vector<UINT8> samples;
  for (UINT32 n = 0; n < 19; n++)
    EXPECT_EQ(Cell(n), Expected(under[n], n == 0 ? 174 : 92, false, &samples)) << "cell " << n;
  ASSERT_EQ(samples.size(), 19u * 38);
  EXPECT_EQ(std::vector<UINT8>(table.begin(), table.begin() + 722), samples);
  EXPECT_EQ(std::vector<UINT8>(table.begin() + 722, table.end()), std::vector<UINT8>(8, 0xEE));

  // Each row: the cells from the first to the last and the level of each
  // afterwards; cells not named keep what they showed.
  struct Step {
    INT32 first, last;
    std::vector<std::pair<UINT32, UINT32>> cells;
  };
  const Step steps[] = {
      {0, 1, {{0, 230}, {1, 174}}},
      {0, 1, {{0, 230}, {1, 174}}},  // the same again: the samples are unchanged
      {3, 3, {{3, 174}}},
      {-2, 0, {{0, 174}}},
      {17, 19, {{17, 230}, {18, 230}}},
      {17, 40, {{17, 230}, {18, 230}}},
      {5, 4, {}},
  };
  for (const Step &step : steps) {
    std::vector<std::vector<UINT32>> want;
    for (UINT32 n = 0; n < 19; n++)
      want.push_back(Cell(n));
    for (auto [n, level] : step.cells)
      want[n] = Expected(under[n], level, true);
    nimb::DrawResumeProgress(table.data(), step.first, step.last);
    for (UINT32 n = 0; n < 19; n++)
      EXPECT_EQ(Cell(n), want[n]) << "cell " << n << " after (" << step.first << ", " << step.last << ")";
  }
}

INSTANTIATE_TEST_SUITE_P(Depths, ResumeBarTest, ::testing::Values(16u, 32u),
                         [](const ::testing::TestParamInfo<UINT32> &info) {
                           return std::to_string(info.param) + "bit";
                         });

class ResumeScreenTest : public nimbtest::LoaderTest {
 protected:
  void SetUp() override {
    LoaderTest::SetUp();
    fw.AddScreen({kWidth, kHeight, 32});
    ASSERT_EQ(nimb::InitConsole(), EFI_SUCCESS);
  }
  UINT32 Pixel(UINT32 x, UINT32 y) { return fw.ScreenPixel(x, y) & 0xFFFFFF; }
  std::vector<UINT8> table = std::vector<UINT8>(nimb::kProgressSaveTableBytes);
};

TEST_F(ResumeScreenTest, PreviewOrLogoAndNothingWithoutAFrameBuffer) {
  std::string error;
  const std::vector<UINT8> good = previewenc::EncodePreview(
      std::vector<uint32_t>(kWidth * kHeight, 0x00336699), kWidth, kHeight, 4, &error);
  const std::vector<UINT8> small =
      previewenc::EncodePreview(std::vector<uint32_t>(kWidth * 2, 0x00336699), kWidth, 2, 4, &error);
  const UINT32 centre = kWidth / 2, middle = kHeight / 2;

  nimb::DrawResumeScreen(good.data(), good.data() + good.size(), table.data());
  EXPECT_EQ(fw.CallCount("UgaBlt"), 0u) << "no logo over a preview";
  const UINT32 flat = Pixel(centre, middle);
  EXPECT_EQ(Pixel(5, 5), flat);
  EXPECT_LT(Pixel(0, 0) & 0xFF, flat & 0xFF) << "the edge samples beyond the picture count as 0";
  EXPECT_EQ(Pixel(kBarLeft + 3, kBarTop + 5), Grey(174, 32));

  for (const std::vector<UINT8> *picture : {&small, &good}) {
    // The wrong size, and the right picture cut short by one byte.
    const UINT8 *end = picture->data() + picture->size() - (picture == &good ? 1 : 0);
    const unsigned blts = fw.CallCount("UgaBlt");
    nimb::DrawResumeScreen(picture->data(), end, table.data());
    EXPECT_GT(fw.CallCount("UgaBlt"), blts) << "the logo instead";
    EXPECT_EQ(Pixel(centre - 64, middle - 64), 0xBFBFBFu);
  }

  fw.SetFrameBufferInfoPresent(false);
  nimb::gFrameBufferBase = 0;
  const unsigned blts = fw.CallCount("UgaBlt");
  nimb::DrawResumeScreen(nullptr, nullptr, table.data());
  EXPECT_EQ(fw.CallCount("UgaBlt"), blts) << "without a frame buffer not even the logo";
}

// --- the preview decoder --------------------------------------------------------------

UINT32 Sample(UINT32 pixel, UINT32 bytes) {
  const UINT32 l =
      bytes == 2 ? (13933 * ((pixel >> 10) & 31) + 46871 * ((pixel >> 5) & 31) + 4732 * (pixel & 31)) >> 13
                 : (13933 * (pixel >> 24) + 46871 * ((pixel >> 16) & 255) + 4732 * (pixel & 255)) >> 16;
  return (l * 19661 + 0x670000) >> 16;
}

// The blur as a plain 5 x 5 convolution: samples left of and above the
// picture count as 0, right of and below it repeat the last.
std::vector<UINT32> ReferenceBlur(const std::vector<uint32_t> &pixels, UINT32 width, UINT32 height,
                                  UINT32 bytes) {
  const UINT32 weight[5] = {1, 4, 6, 4, 1};
  std::vector<UINT32> out;
  for (INT32 y = 0; y < INT32(height); y++) {
    for (INT32 x = 0; x < INT32(width); x++) {
      UINT32 sum = 0;
      for (INT32 dy = -2; dy <= 2; dy++) {
        for (INT32 dx = -2; dx <= 2; dx++) {
          if (x + dx < 0 || y + dy < 0)
            continue;
          const UINT32 sx = std::min<UINT32>(x + dx, width - 1), sy = std::min<UINT32>(y + dy, height - 1);
          sum += weight[dx + 2] * weight[dy + 2] * Sample(pixels[sy * width + sx], bytes);
        }
      }
      const UINT32 w = ((sum + 128) >> 11) & 31;
      out.push_back(bytes == 2 ? w | w << 5 | w << 10 : Grey(((sum + 128) >> 8) & 255, 32));
    }
  }
  return out;
}

class ResumePreviewTest : public nimbtest::LoaderTest {
 protected:
  void SetUp() override {
    LoaderTest::SetUp();
    // The tracking's first tag block stays once taken.
    nimb::TrackedFree(nimb::TrackedAllocatePool(16));
    poolBlocks_ = fw.LivePoolBlocks();
  }
  // Decodes into a frame buffer of rows 8 bytes longer than the picture,
  // filled with 0x5A; the pixels, or nothing when it returned false.
  bool Decode(const std::vector<UINT8> &preview, UINT32 width, UINT32 height, UINT32 bytes,
              std::vector<UINT32> *pixels, size_t cut = 0) {
    const UINT32 rowBytes = width * bytes + 8;
    std::vector<UINT8> frame(rowBytes * height + 16, 0x5A);
    std::vector<UINT8> section(preview.begin(), preview.end() - cut);  // exactly sized, for ASan
    const bool drawn = nimb::DrawResumePreview(section.data(), section.data() + section.size(), frame.data(),
                                               width, height, bytes, INT32(rowBytes));
    for (UINT32 y = 0; y < height; y++) {
      for (UINT32 x = 0; x < width; x++) {
        UINT32 value = 0;
        std::memcpy(&value, &frame[y * rowBytes + x * bytes], bytes);
        pixels->push_back(value);
      }
      EXPECT_EQ(std::vector<UINT8>(&frame[y * rowBytes + width * bytes], &frame[(y + 1) * rowBytes]),
                std::vector<UINT8>(8, 0x5A))
          << "row " << y << "'s padding";
    }
    EXPECT_EQ(std::vector<UINT8>(frame.end() - 16, frame.end()), std::vector<UINT8>(16, 0x5A));
    if (!drawn) {
      UINT32 untouched = 0;
      std::memset(&untouched, 0x5A, bytes);
      EXPECT_EQ(*pixels, std::vector<UINT32>(pixels->size(), untouched)) << "nothing drawn";
    }
    EXPECT_EQ(fw.LivePoolBlocks(), poolBlocks_) << "the sums are given back";
    return drawn;
  }

  size_t poolBlocks_ = 0;
};

TEST_F(ResumePreviewTest, EncodedPicturesComeOutAsTheReferenceBlur) {
  const struct {
    const char *name;
    UINT32 width, height, bytes;
    uint32_t (*pixel)(UINT32 x, UINT32 y);
  } rows[] = {
      {"flat", 9, 7, 4, [](UINT32, UINT32) -> uint32_t { return 0xC0FFEE00; }},
      {"stripes and runs, 32-bit", 23, 11, 4,
       [](UINT32 x, UINT32 y) -> uint32_t {
         return x < 10 ? 0xFF00FF00 : (x * 0x01234567u) ^ (y * 0x89ABCDEFu);
       }},
      {"noise, 16-bit", 17, 13, 2,
       [](UINT32 x, UINT32 y) -> uint32_t { return (x * 2654435761u ^ y * 40503u) >> 7; }},
      {"one pixel", 1, 1, 2, [](UINT32, UINT32) -> uint32_t { return 0xFFFF; }},
      {"one column, top bit set", 1, 9, 2, [](UINT32, UINT32 y) -> uint32_t { return 0x8000 | y * 1000; }},
  };
  for (const auto &row : rows) {
    std::vector<uint32_t> pixels;
    for (UINT32 y = 0; y < row.height; y++)
      for (UINT32 x = 0; x < row.width; x++)
        pixels.push_back(row.pixel(x, y));
    std::string error;
    const std::vector<UINT8> preview =
        previewenc::EncodePreview(pixels, row.width, row.height, row.bytes, &error);
    ASSERT_FALSE(preview.empty()) << error;
    std::vector<UINT32> out;
    EXPECT_TRUE(Decode(preview, row.width, row.height, row.bytes, &out)) << row.name;
    EXPECT_EQ(out, ReferenceBlur(pixels, row.width, row.height, row.bytes)) << row.name;
  }
}

// A hand-made 3 x 2 picture of 4-byte pixels: row 0 a repeat run of 5 (only
// 3 are taken), row 1 a literal run of 3; `patches` change words of it.
std::vector<UINT8> HandMade(std::vector<std::pair<size_t, UINT32>> patches = {}) {
  const UINT32 words[] = {4, 3, 2, 20, 28, 0x01000005, 0x00FFFFFF, 3, 0x00FFFFFF, 0, 0x00FFFFFF};
  std::vector<UINT8> out(sizeof words);
  std::memcpy(out.data(), words, sizeof words);
  for (auto [word, value] : patches)
    std::memcpy(&out[4 * word], &value, 4);
  return out;
}

TEST_F(ResumePreviewTest, BrokenOrMismatchedPicturesDrawNothing) {
  std::vector<UINT32> white, black;
  ASSERT_TRUE(Decode(HandMade(), 3, 2, 4, &white));
  ASSERT_TRUE(Decode(HandMade({{8, 0}, {10, 0}}), 3, 2, 4, &black));
  EXPECT_NE(white[0], black[0]) << "row 1 is read from its own offset";
  const struct {
    const char *name;
    std::vector<UINT8> preview;
    UINT32 width, height, bytes;
    size_t cut;
  } rows[] = {
      {"another width", HandMade(), 4, 2, 4, 0},
      {"another height", HandMade(), 3, 3, 4, 0},
      {"a 32-bit picture on a 16-bit screen", HandMade(), 3, 2, 2, 0},
      {"3 bytes per pixel", HandMade({{0, 3}}), 3, 2, 3, 0},
      {"a run of 0 pixels", HandMade({{7, 0}}), 3, 2, 4, 0},
      {"a repeat run of 0 pixels", HandMade({{5, 0x01000000}}), 3, 2, 4, 0},
      {"a row offset past the end", HandMade({{4, 44}}), 3, 2, 4, 0},
      {"a row offset far out", HandMade({{3, 0xFFFFFFF0}}), 3, 2, 4, 0},
      {"a row that ends early", HandMade(), 3, 2, 4, 1},
      {"no room for the row table", HandMade({{3, 0}}), 3, 2, 4, 28},
      {"no header", HandMade(), 3, 2, 4, 33},
  };
  for (const auto &row : rows) {
    std::vector<UINT32> out;
    EXPECT_FALSE(Decode(row.preview, row.width, row.height, row.bytes, &out, row.cut)) << row.name;
  }
}

}  // namespace
