// The boot screen's pictures and its colour table. Pictures are 8-bit
// indexes into the colour table; every picture has the screen's grey,
// index 1, in its corners. The data is made by tools/artwork/make_artwork.py.
#pragma once

#include "efi/efi.h"

namespace nimb {

constexpr UINTN kColorTableSize = 768;  // 256 entries of red, green, blue
constexpr UINT8 kBackgroundIndex = 1;   // (191, 191, 191)

constexpr UINT32 kPictureSize = 128;  // logo and failure picture: 128 x 128
constexpr UINTN kPictureBytes = kPictureSize * kPictureSize;
constexpr UINTN kLogoPairs = 686;  // (count, index), counts 1..255

constexpr UINT32 kSpinnerSize = 32;  // a frame: 32 x 32
constexpr UINT32 kSpinnerFrames = 18;
constexpr UINTN kSpinnerFramePixels = kSpinnerSize * kSpinnerSize;
constexpr UINTN kSpinnerStripBytes = kSpinnerFramePixels * kSpinnerFrames;

extern const UINT8 kBootColorTable[kColorTableSize];
extern const UINT8 kLogoRuns[kLogoPairs * 2];
extern const UINT8 kFailurePicture[kPictureBytes];
extern const UINT8 kSpinnerStrip[kSpinnerStripBytes];

}  // namespace nimb
