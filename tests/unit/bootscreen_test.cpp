// The boot screen: the artwork's form, the logo and the spinner on the host
// firmware's screen, the failure picture, and the video facts for the kernel.
#include "screen/bootscreen.h"

#include <gtest/gtest.h>

#include <cstring>
#include <string>
#include <vector>

#include "boot/bootinfo.h"
#include "efi/vendor.h"
#include "loader_fixture.h"
#include "screen/artwork.h"

namespace {

using nimb::kPictureSize;
using nimb::kSpinnerSize;

std::vector<UINT8> DecodedLogo() {
  std::vector<UINT8> logo;
  for (size_t pair = 0; pair < nimb::kLogoPairs; pair++)
    logo.insert(logo.end(), nimb::kLogoRuns[2 * pair], nimb::kLogoRuns[2 * pair + 1]);
  return logo;
}

const UINT8 *SpinnerFrame(UINT32 frame) {
  return nimb::kSpinnerStrip + frame * nimb::kSpinnerFramePixels;
}

// 0xRRGGBB of a colour table entry.
UINT32 Rgb(UINT8 index) {
  const UINT8 *entry = &nimb::kBootColorTable[3 * index];
  return UINT32(entry[0]) << 16 | UINT32(entry[1]) << 8 | entry[2];
}

constexpr UINT32 kGrey = 0xBFBFBF;

TEST(BootScreenArtwork, LogoFillsOnePictureAndEveryPictureHasGreyCorners) {
  EXPECT_EQ(DecodedLogo().size(), nimb::kPictureBytes);
  EXPECT_EQ(std::vector<UINT32>({Rgb(0), Rgb(1), Rgb(255)}), std::vector<UINT32>({0xFFFFFF, kGrey, 0}));
  const std::vector<UINT8> logo = DecodedLogo();
  std::vector<std::pair<const UINT8 *, UINT32>> pictures = {{logo.data(), kPictureSize},
                                                            {nimb::kFailurePicture, kPictureSize}};
  for (UINT32 frame = 0; frame < nimb::kSpinnerFrames; frame++)
    pictures.push_back({SpinnerFrame(frame), kSpinnerSize});
  for (const auto &[indexes, size] : pictures) {
    const UINT32 last = size - 1;
    for (UINT32 corner : {0u, last, last * size, last * size + last})
      EXPECT_EQ(indexes[corner], nimb::kBackgroundIndex) << size << " at " << corner;
  }
}

class BootScreenTest : public nimbtest::LoaderTest {
 protected:
  void SetUp() override {
    LoaderTest::SetUp();
    fw.AddScreen({800, 600});
    ASSERT_EQ(nimb::InitConsole(), EFI_SUCCESS);
    // One tracked block taken and given back leaves a free tag behind, so
    // that the next pool allocations are the screen's own.
    nimb::TrackedFree(nimb::TrackedAllocatePool(16));
  }

  UINT32 Color(UINT32 x, UINT32 y) { return fw.ScreenPixel(x, y) & 0xFFFFFF; }

  // Whether the square at (x0, y0) shows `indexes`; null: all grey.
  bool Shows(UINT32 x0, UINT32 y0, UINT32 size, const UINT8 *indexes) {
    for (UINT32 y = 0; y < size; y++) {
      for (UINT32 x = 0; x < size; x++) {
        if (Color(x0 + x, y0 + y) != (indexes != nullptr ? Rgb(indexes[y * size + x]) : kGrey))
          return false;
      }
    }
    return true;
  }
  bool ShowsLogo() { return Shows(kLogoX, kLogoY, kPictureSize, DecodedLogo().data()); }
  bool ShowsSpinner(const UINT8 *frame) { return Shows(kSpinnerX, kSpinnerY, kSpinnerSize, frame); }

  // 800 x 600: the logo at (336, 236), the spinner at (384, 484).
  static constexpr UINT32 kLogoX = 336, kLogoY = 236, kSpinnerX = 384, kSpinnerY = 484;
};

TEST_F(BootScreenTest, DiskBootShowsTheLogoCentredOnGreyAndNoSpinner) {
  const size_t poolBefore = fw.LivePoolBlocks();
  nimb::ShowBootScreen();
  EXPECT_EQ(nimb::gConsoleMode, UINT32(EfiConsoleControlScreenGraphics));
  EXPECT_NE(nimb::gBootFlags & nimb::kBootGraphics, 0u);
  EXPECT_EQ(std::vector<UINT32>({nimb::gScreenWidth, nimb::gScreenHeight, nimb::gScreenDepth}),
            std::vector<UINT32>({800, 600, 32}));
  EXPECT_TRUE(ShowsLogo());
  EXPECT_NE(Color(kLogoX + 64, kLogoY + 64), kGrey) << "the mark stands in the middle";
  EXPECT_EQ(fw.ScreenPixel(kLogoX + 64, kLogoY + 64) >> 24, 0u) << "the pixels' unused byte is zero";
  for (const auto &[x, y] : {std::pair<UINT32, UINT32>{0, 0}, {799, 599}, {400, 500}})
    EXPECT_EQ(Color(x, y), kGrey) << x << "," << y;
  EXPECT_TRUE(fw.Events().empty());
  EXPECT_EQ(fw.LivePoolBlocks(), poolBefore) << "the logo's buffers went back";
}

TEST_F(BootScreenTest, OnOddSizesThePicturesStandInTheMiddleAndTheSpinner200Below) {
  fw.AddScreen({1023, 767});
  nimb::gBootFlags = nimb::kBootNetwork;
  nimb::DrawBootScreen();
  std::vector<UINTN> places;
  for (const auto &blt : fw.BltCalls())
    places.insert(places.end(), {blt.destinationX, blt.destinationY});
  EXPECT_EQ(places, std::vector<UINTN>({0, 0, 447, 319, 495, 567}));
  nimb::StopSpinner();
}

TEST_F(BootScreenTest, WithoutGraphicsNothingIsDrawn) {
  const struct {
    const char *what;
    bool textAtStart;
    bool uga;
    const char *failCall;
    EFI_STATUS status;
    bool graphicsFlag;
  } rows[] = {
      {"no UGA Draw", false, false, nullptr, EFI_UNSUPPORTED, false},
      {"SetMode refused", true, true, "SetMode", EFI_DEVICE_ERROR, false},
      {"GetMode refused", false, true, "UgaGetMode", EFI_DEVICE_ERROR, true},
  };
  for (const auto &row : rows) {
    nimbtest::ResetLoaderState();
    Attach();
    fw.SetUgaDrawPresent(row.uga);
    fw.SetConsoleMode(row.textAtStart ? EfiConsoleControlScreenText : EfiConsoleControlScreenGraphics);
    ASSERT_EQ(nimb::InitConsole(), EFI_SUCCESS) << row.what;
    const size_t blts = fw.BltCalls().size();
    if (row.failCall != nullptr)
      fw.FailCall(row.failCall);
    EXPECT_EQ(nimb::EnterGraphics(), row.status) << row.what;
    EXPECT_EQ((nimb::gBootFlags & nimb::kBootGraphics) != 0, row.graphicsFlag) << row.what;
    if (row.failCall != nullptr)
      fw.FailCall(row.failCall);
    nimb::gBootFlags = nimb::kBootNetwork;
    nimb::ShowBootScreen();
    EXPECT_EQ(fw.BltCalls().size(), blts) << row.what;
    EXPECT_TRUE(fw.Events().empty()) << row.what;
  }
}

TEST_F(BootScreenTest, FailureScreenOnlyInGraphicsModeWithUgaKnown) {
  const struct {
    const char *what;
    bool enterGraphics;
    UINT32 mode;
    bool drawn;
  } rows[] = {
      {"graphics, UGA known", true, EfiConsoleControlScreenGraphics, true},
      {"text mode restored", true, EfiConsoleControlScreenText, false},
      {"graphics, UGA never looked up", false, EfiConsoleControlScreenGraphics, false},
  };
  for (const auto &row : rows) {
    fw.AddScreen({800, 600});
    nimb::gUgaDraw = nullptr;
    if (row.enterGraphics)
      ASSERT_EQ(nimb::EnterGraphics(), EFI_SUCCESS) << row.what;
    nimb::gConsoleMode = row.mode;
    const size_t poolBefore = fw.LivePoolBlocks();
    nimb::DrawFailureScreen();
    EXPECT_EQ(fw.BltCalls().size(), row.drawn ? 2u : 0u) << row.what;
    if (row.drawn)
      EXPECT_TRUE(Shows(kLogoX, kLogoY, kPictureSize, nimb::kFailurePicture) && Color(0, 0) == kGrey);
    EXPECT_EQ(fw.LivePoolBlocks(), poolBefore) << row.what;
  }
}

TEST_F(BootScreenTest, SpinnerNetworkBootTurnsFrameByFrameUntilStopped) {
  nimb::gBootFlags = nimb::kBootNetwork;
  nimb::ShowBootScreen();
  EXPECT_TRUE(ShowsSpinner(SpinnerFrame(0)));
  ASSERT_EQ(fw.Events().size(), 1u);
  const hostfw::EventRecord event = fw.Events()[0];
  EXPECT_EQ(event.type, UINT32(EVT_TIMER | EVT_NOTIFY_SIGNAL));
  EXPECT_EQ(event.tpl, EFI_TPL(TPL_NOTIFY));
  EXPECT_EQ(event.timerType, TimerPeriodic);
  EXPECT_EQ(event.triggerTime, 1000000u);
  // After frame 17 comes frame 0.
  for (UINT32 tick = 1; tick <= 19; tick++) {
    fw.FireEvent(event.event);
    EXPECT_TRUE(ShowsSpinner(SpinnerFrame(tick % 18))) << "tick " << tick;
  }

  EFI_UGA_PIXEL *frames = nimb::gSpinnerPixels;
  nimb::StopSpinner();
  EXPECT_TRUE(fw.Events()[0].closed);
  EXPECT_EQ(nimb::gSpinnerEvent, nullptr);
  EXPECT_EQ(nimb::gSpinnerPixels, frames) << "the frames stay allocated";
  EXPECT_TRUE(ShowsSpinner(nullptr));
  EXPECT_TRUE(ShowsLogo());
}

TEST_F(BootScreenTest, SpinnerWhatIsLeftWhenTheFirmwareRefuses) {
  const struct {
    const char *what;
    const char *failCall;     // a service refused once
    unsigned failAllocation;  // or the n-th allocation from the drawing on
    bool logo;
    bool frame0;
    size_t events;
  } rows[] = {
      {"CreateEvent refused", "CreateEvent", 0, true, true, 0},
      {"SetTimer refused", "SetTimer", 0, true, true, 1},
      {"no pool for the logo's indexes", nullptr, 1, false, true, 1},
      {"no pool for the spinner", nullptr, 3, true, false, 0},
  };
  for (const auto &row : rows) {
    fw.AddScreen({800, 600});
    nimb::gSpinnerPixels = nullptr;
    nimb::gBootFlags = nimb::kBootNetwork;
    ASSERT_EQ(nimb::EnterGraphics(), EFI_SUCCESS);
    const size_t eventsBefore = fw.Events().size();
    if (row.failCall != nullptr)
      fw.FailCall(row.failCall);
    else
      fw.FailAllocation(row.failAllocation);
    nimb::DrawBootScreen();
    EXPECT_EQ(ShowsLogo(), row.logo) << row.what;
    EXPECT_EQ(ShowsSpinner(SpinnerFrame(0)), row.frame0) << row.what;
    EXPECT_EQ(ShowsSpinner(nullptr), !row.frame0) << row.what;
    ASSERT_EQ(fw.Events().size() - eventsBefore, row.events) << row.what;
    const bool turning = row.events == 1 && !fw.Events().back().closed;
    EXPECT_EQ(nimb::gSpinnerEvent != nullptr, turning) << row.what;
    if (nimb::gSpinnerEvent != nullptr)
      nimb::StopSpinner();
  }
}

class VideoInfoTest : public BootScreenTest {
 protected:
  static std::vector<UINT32> Fields(const nimb::VideoInfo &v) {
    return {v.baseAddress, v.displayMode, v.rowBytes, v.width, v.height, v.depth};
  }
  // A fresh tree with its memory map node and the kernel region at 2 MiB.
  void StartTree() {
    ASSERT_NE(nimb::DeviceTreeInit(), nullptr);
    nimb::gMemoryMapNode = nimb::DeviceTreeFindNode("/chosen/memory-map", 1);
    nimb::gKernelRegionTop = 0x200000;
  }
  static constexpr UINT32 kUnset = 0xA5A5A5A5;
};

TEST_F(VideoInfoTest, FrameBufferFactsAreFetchedOnceAndCopied) {
  struct Row {
    const char *what;
    bool present;
    bool failGetInfo;
    UINT64 base;  // reported by GetInfo; 0: the screen's own
    bool record;
    UINT64 globalBase;  // expected gFrameBufferBase
    bool written;
  };
  const hostfw::FrameBufferFacts own = fw.ScreenFacts();
  const Row rows[] = {
      {"the screen's own", true, false, 0, true, own.base, true},
      {"above 4 GiB", true, false, 0x123456000, true, 0x123456000, true},
      {"null record", true, false, 0, false, own.base, false},
      {"no protocol", false, false, 0, true, 0, false},
      {"GetInfo refused", true, true, 0, true, 0, false},
  };
  const nimb::VideoInfo unset = {kUnset, kUnset, kUnset, kUnset, kUnset, kUnset};
  for (const auto &row : rows) {
    nimb::gFrameBufferBase = 0;
    nimb::gFrameBufferRowBytes = nimb::gScreenWidth = nimb::gScreenHeight = nimb::gScreenDepth = 0;
    fw.SetFrameBufferInfoPresent(row.present);
    hostfw::FrameBufferFacts facts = own;
    facts.rowBytes = 4096;
    if (row.base != 0)
      facts.base = row.base;
    fw.SetFrameBufferFacts(facts);
    if (row.failGetInfo)
      fw.FailCall("FrameBufferGetInfo");
    nimb::VideoInfo record = unset;
    nimb::GetFrameBufferInfo(row.record ? &record : nullptr);
    EXPECT_EQ(nimb::gFrameBufferBase, row.globalBase) << row.what;
    EXPECT_EQ(Fields(record), row.written
                                  ? std::vector<UINT32>({UINT32(row.globalBase), kUnset, 4096, 800, 600, 32})
                                  : Fields(unset))
        << row.what;
    if (row.globalBase != 0) {
      EXPECT_EQ(nimb::gFrameBufferRowBytes, 4096u) << row.what;
      // Known facts are not asked for again.
      const unsigned asked = fw.CallCount("FrameBufferGetInfo");
      nimb::GetFrameBufferInfo(&record);
      EXPECT_EQ(fw.CallCount("FrameBufferGetInfo"), asked) << row.what;
    }
  }
}

TEST_F(VideoInfoTest, FillVideoInfoHandsOverTheFactsTheColourTableAndTheFailurePicture) {
  const UINT32 base = UINT32(fw.ScreenFacts().base);
  for (bool graphics : {true, false}) {
    StartTree();
    nimb::gFrameBufferBase = 0;
    fw.SetFrameBufferInfoPresent(graphics);
    nimb::gBootFlags = graphics ? nimb::kBootGraphics : 0;
    nimb::BootArgs args;
    std::memset(&args, 0x5A, sizeof(args));
    nimb::FillVideoInfo(&args);
    EXPECT_EQ(std::vector<UINT32>({args.videoDisplayMode, args.videoBaseAddress, args.videoRowBytes,
                                   args.videoWidth, args.videoHeight, args.videoDepth}),
              graphics ? std::vector<UINT32>({1, base, 3200, 800, 600, 32})
                       : std::vector<UINT32>({2, 0, 0, 0, 0, 0}));

    // Address and length of each range, and what lies there.
    for (const auto &[name, range] :
         {std::pair<const char *, std::vector<UINT32>>{"BootCLUT", {0x200000, 768}},
          {"Pict-FailedBoot", {0x201000, 16416}}}) {
      const nimb::DeviceTreeProperty *property = nimb::DeviceTreeFindProperty(nimb::gMemoryMapNode, name);
      ASSERT_NE(property, nullptr) << name;
      ASSERT_EQ(property->length, 8u);
      const UINT32 *value = static_cast<const UINT32 *>(property->value);
      EXPECT_EQ(std::vector<UINT32>(value, value + 2), range) << name;
    }
    EXPECT_EQ(nimb::gKernelRegionTop, 0x206000u);
    EXPECT_EQ(std::memcmp(reinterpret_cast<void *>(0x200000), nimb::kBootColorTable, 768), 0);
    const auto *picture = reinterpret_cast<const UINT32 *>(0x201000);
    // Width, height and zeros (not what the pages held) up to the indexes.
    EXPECT_EQ(std::vector<UINT32>(picture, picture + 8), std::vector<UINT32>({128, 128, 0, 0, 0, 0, 0, 0}));
    EXPECT_EQ(std::memcmp(picture + 8, nimb::kFailurePicture, 16384), 0);
    nimb::TrackedFreeAll();
  }

  // No room in the kernel region is fatal.
  const char *messages[] = {"Could not allocate CLUT", "Could not allocate Pict-FailedBoot"};
  for (unsigned nth : {1, 2}) {
    const char *message = messages[nth - 1];
    StartTree();
    nimb::BootArgs args = {};
    fw.FailCall("AllocatePages", nth);
    const hostfw::RunResult result = fw.Call([&] { nimb::FillVideoInfo(&args); });
    EXPECT_EQ(result.end, hostfw::RunEnd::Exited) << message;
    EXPECT_EQ(result.status, EFI_ABORTED) << message;
    const std::string text = fw.ConOutText();
    EXPECT_EQ(text.substr(text.size() - std::min(text.size(), strlen(message))), message);
  }
}

}  // namespace
