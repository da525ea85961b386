#include "screen/resume_display.h"

#include "memory/tracking.h"
#include "screen/bootscreen.h"
#include "support/strings.h"

namespace nimb {

namespace {

// --- the progress bar ----------------------------------------------------------------

constexpr UINT32 kCellWidth = 7;
constexpr UINT32 kCellHeight = 16;
constexpr UINT32 kCellPitch = 10;                          // a cell and a gap of 3
constexpr UINT32 kBarWidth = kProgressCells * kCellPitch;  // 190, the last gap included
constexpr UINT32 kBarFromBottom = 97;

constexpr UINT32 kLevelWaiting = 92;
constexpr UINT32 kLevelWorking = 174;
constexpr UINT32 kLevelFinished = 230;

// Alpha of each pixel of a cell: 0 leaves the screen, 255 paints it, the
// rest blend. 38 blended positions: 5 in the first and last rows, 2 in each
// row between.
constexpr UINT8 kCellMask[kCellHeight][kCellWidth] = {
    {0, 99, 216, 240, 216, 99, 0},       {81, 255, 255, 255, 255, 255, 81},
    {174, 255, 255, 255, 255, 255, 174}, {195, 255, 255, 255, 255, 255, 195},
    {195, 255, 255, 255, 255, 255, 195}, {195, 255, 255, 255, 255, 255, 195},
    {195, 255, 255, 255, 255, 255, 195}, {195, 255, 255, 255, 255, 255, 195},
    {195, 255, 255, 255, 255, 255, 195}, {195, 255, 255, 255, 255, 255, 195},
    {195, 255, 255, 255, 255, 255, 195}, {195, 255, 255, 255, 255, 255, 195},
    {195, 255, 255, 255, 255, 255, 195}, {174, 255, 255, 255, 255, 255, 174},
    {84, 255, 255, 255, 255, 255, 84},   {0, 102, 219, 243, 219, 102, 0},
};

// A grey level as a pixel of the screen's depth.
inline UINT32 GreyPixel(UINT32 level, UINT32 pixelShift) {
  if (pixelShift == 1) {
    const UINT32 w = level >> 3;
    return w | w << 5 | w << 10;
  }
  return level | level << 8 | level << 16;
}

inline UINT32 ReadPixel(const UINT8 *at, UINT32 pixelShift) {
  return pixelShift == 1 ? *reinterpret_cast<const UINT16 *>(at) : *reinterpret_cast<const UINT32 *>(at);
}

inline void WritePixel(UINT8 *at, UINT32 pixelShift, UINT32 pixel) {
  if (pixelShift == 1) {
    *reinterpret_cast<UINT16 *>(at) = static_cast<UINT16>(pixel);
  } else {
    *reinterpret_cast<UINT32 *>(at) = pixel;
  }
}

// The 8-bit grey of the background under a blended position: the low 5
// bits of a 16-bit pixel spread to 8, the low byte of a 32-bit pixel.
inline UINT8 BackgroundLevel(UINT32 pixel, UINT32 pixelShift) {
  if (pixelShift == 1) {
    const UINT32 x = pixel & 0x1F;
    return static_cast<UINT8>(x * 8 | x >> 2);
  }
  return static_cast<UINT8>(pixel);
}

// Bytes per pixel as a shift: 1 for 16 bits, 2 for 32 bits. The bar is
// drawn only at these two depths, on a screen that can hold it, and with a
// known frame buffer.
UINT32 BarPixelShift() {
  if (gFrameBufferBase == 0 || (gScreenDepth != 16 && gScreenDepth != 32) || gScreenWidth < kBarWidth ||
      gScreenHeight < kBarFromBottom) {
    return 0;
  }
  return gScreenDepth >> 4;
}

// Paints cells `first` to `last` row by row from the top, each row across
// the cells from left to right: cells below `finished` at the finished
// level, cells up to `working` at the working level, the rest waiting.
// At the first drawing (`save` not null) every blended position's
// background goes to the save table and the blend is shifted by 8; at a
// repaint the background comes back from `saved` and the blend is divided
// by 255. Each cell's samples are counted from 0 in every call.
void PaintCells(UINT8 *save, const UINT8 *saved, UINT32 first, UINT32 last, UINT32 finished, UINT32 working) {
  const UINT32 shift = BarPixelShift();
  if (shift == 0) {
    return;
  }
  UINT32 counters[kProgressCells] = {};
  const UINTN left = static_cast<UINTN>((gScreenWidth - kBarWidth) / 2) << shift;
  UINT8 *row = reinterpret_cast<UINT8 *>(gFrameBufferBase) +
               static_cast<UINTN>(gScreenHeight - kBarFromBottom) * gFrameBufferRowBytes + left;
  for (UINT32 y = 0; y < kCellHeight; y++, row += gFrameBufferRowBytes) {
    for (UINT32 n = first; n <= last; n++) {
      const UINT32 level = n < finished ? kLevelFinished : n <= working ? kLevelWorking : kLevelWaiting;
      UINT8 *cell = row + (static_cast<UINTN>(n * kCellPitch) << shift);
      for (UINT32 x = 0; x < kCellWidth; x++) {
        const UINT32 a = kCellMask[y][x];
        if (a == 0) {
          continue;
        }
        UINT8 *at = cell + (static_cast<UINTN>(x) << shift);
        UINT32 grey = level;
        if (a != 255) {
          const UINTN sample = n * kProgressSamplesPerCell + counters[n]++;
          if (save != nullptr) {
            save[sample] = BackgroundLevel(ReadPixel(at, shift), shift);
            grey = ((255 - a) * save[sample] + a * level + 255) >> 8;
          } else {
            grey = ((255 - a) * saved[sample] + a * level + 255) / 255;
          }
        }
        WritePixel(at, shift, GreyPixel(grey, shift));
      }
    }
  }
}

// --- the preview picture ---------------------------------------------------------------

constexpr UINT32 kPreviewHeaderBytes = 12;  // bytes per pixel, width, height
constexpr UINT32 kRunCountMask = 0xFFFFFF;

inline UINT32 LittleEndian32(const UINT8 *at) {
  return static_cast<UINT32>(at[0]) | static_cast<UINT32>(at[1]) << 8 | static_cast<UINT32>(at[2]) << 16 |
         static_cast<UINT32>(at[3]) << 24;
}

inline UINT32 PreviewPixel(const UINT8 *at, UINT32 bytesPerPixel) {
  return bytesPerPixel == 2 ? static_cast<UINT32>(at[0]) | static_cast<UINT32>(at[1]) << 8
                            : LittleEndian32(at);
}

// The dimmed luminance of a picture pixel, 103 to 179.
inline UINT32 GreySample(UINT32 pixel, UINT32 bytesPerPixel) {
  UINT32 l;
  if (bytesPerPixel == 2) {
    l = (13933 * ((pixel >> 10) & 0x1F) + 46871 * ((pixel >> 5) & 0x1F) + 4732 * (pixel & 0x1F)) >> 13;
  } else {
    l = (13933 * (pixel >> 24) + 46871 * ((pixel >> 16) & 0xFF) + 4732 * (pixel & 0xFF)) >> 16;
  }
  return (l * 19661 + 0x670000) >> 16;
}

// Walks the runs of every row the way the decoder will, without drawing:
// each control word and each pixel the decoder would read must lie inside
// the section, and no run may be empty.
bool PreviewRunsFit(const UINT8 *preview, UINTN sectionBytes, UINT32 width, UINT32 height,
                    UINT32 bytesPerPixel) {
  const UINT8 *rowTable = preview + kPreviewHeaderBytes;
  for (UINT32 y = 0; y < height; y++) {
    UINTN at = LittleEndian32(rowTable + 4 * static_cast<UINTN>(y));
    for (UINT32 x = 0; x < width;) {
      if (at > sectionBytes || sectionBytes - at < 4 + bytesPerPixel) {
        return false;
      }
      const UINT32 control = LittleEndian32(preview + at);
      const UINT32 count = control & kRunCountMask;
      if (count == 0) {
        return false;
      }
      const UINT32 taken = count < width - x ? count : width - x;
      const UINTN bytes = 4 + static_cast<UINTN>(control >> 24 == 0 ? taken : 1) * bytesPerPixel;
      if (sectionBytes - at < bytes) {
        return false;
      }
      at += bytes;
      x += taken;
    }
  }
  return true;
}

}  // namespace

BOOLEAN DrawResumePreview(const UINT8 *preview, const UINT8 *previewEnd, UINT8 *frameBuffer, UINT32 width,
                          UINT32 height, UINT32 bytesPerPixel, INT32 rowBytes) {
  if (preview == nullptr || previewEnd < preview ||
      static_cast<UINTN>(previewEnd - preview) < kPreviewHeaderBytes) {
    return FALSE;
  }
  const UINTN sectionBytes = static_cast<UINTN>(previewEnd - preview);
  if (LittleEndian32(preview) != bytesPerPixel || LittleEndian32(preview + 4) != width ||
      LittleEndian32(preview + 8) != height) {
    return FALSE;
  }
  if ((bytesPerPixel != 2 && bytesPerPixel != 4) || width == 0 || height == 0 || rowBytes < 0 ||
      static_cast<UINT64>(rowBytes) < static_cast<UINT64>(width) * bytesPerPixel ||
      (sectionBytes - kPreviewHeaderBytes) / 4 < height ||
      !PreviewRunsFit(preview, sectionBytes, width, height, bytesPerPixel)) {
    return FALSE;
  }

  // Four lines of vertical sums, one entry per column and two beyond.
  const UINTN line = static_cast<UINTN>(width) + 2;
  UINT16 *sums = static_cast<UINT16 *>(TrackedAllocatePool(4 * line * sizeof(UINT16)));
  if (sums == nullptr) {
    return FALSE;
  }
  memset(sums, 0, 4 * line * sizeof(UINT16));
  UINT16 *col0 = sums, *col1 = sums + line, *col2 = sums + 2 * line, *col3 = sums + 3 * line;

  const UINTN step = static_cast<UINTN>(rowBytes) / bytesPerPixel * bytesPerPixel;
  UINT8 *out = frameBuffer;
  const UINT8 *rowTable = preview + kPreviewHeaderBytes;
  // The filter runs two rows and two columns behind its input; beyond the
  // last row and column their samples repeat, before the first they are 0.
  for (UINT32 y = 0; y < height + 2; y++) {
    const UINT32 source = y < height ? y : height - 1;
    const UINT8 *data = preview + LittleEndian32(rowTable + 4 * static_cast<UINTN>(source));
    UINT32 s = 0, p0 = 0, p1 = 0, p2 = 0, p3 = 0;
    UINT32 runLeft = 0;
    bool literal = false;
    for (UINT32 x = 0; x < width + 2; x++) {
      if (x < width) {
        bool read = literal;
        if (runLeft == 0) {
          const UINT32 control = LittleEndian32(data);
          data += 4;
          runLeft = control & kRunCountMask;
          literal = control >> 24 == 0;
          read = true;
        }
        if (read) {
          s = GreySample(PreviewPixel(data, bytesPerPixel), bytesPerPixel);
          data += bytesPerPixel;
        }
        runLeft--;
      }
      const UINT32 h1 = p0 + s, h2 = p1 + h1, h3 = p2 + h2, h4 = p3 + h3;
      p0 = s;
      p1 = h1;
      p2 = h2;
      p3 = h3;
      const UINT32 u1 = h4 + col0[x];
      col0[x] = static_cast<UINT16>(h4);
      const UINT32 u2 = u1 + col1[x];
      col1[x] = static_cast<UINT16>(u1);
      const UINT32 u3 = u2 + col2[x];
      col2[x] = static_cast<UINT16>(u2);
      const UINT32 u4 = u3 + col3[x];
      col3[x] = static_cast<UINT16>(u3);
      if (y > 1 && x > 1) {
        UINT8 *at = out + static_cast<UINTN>(x - 2) * bytesPerPixel;
        if (bytesPerPixel == 4) {
          WritePixel(at, 2, GreyPixel(((u4 + 128) >> 8) & 0xFF, 2));
        } else {
          // Five bits straight from the sum: the 8-bit level's low bits
          // would be dropped anyway.
          WritePixel(at, 1, GreyPixel((((u4 + 128) >> 11) & 0x1F) << 3, 1));
        }
      }
    }
    if (y > 1) {
      out += step;
    }
  }
  TrackedFree(sums);
  return TRUE;
}

void DrawResumeScreen(const UINT8 *preview, const UINT8 *previewEnd, UINT8 *saveTable) {
  if (EFI_ERROR(EnterGraphics())) {
    return;
  }
  GetFrameBufferInfo(nullptr);
  if (gFrameBufferBase == 0) {
    return;
  }
  if (preview == nullptr ||
      !DrawResumePreview(preview, previewEnd, reinterpret_cast<UINT8 *>(gFrameBufferBase), gScreenWidth,
                         gScreenHeight, gScreenDepth >> 3, static_cast<INT32>(gFrameBufferRowBytes))) {
    DrawBootScreen();
  }
  PaintCells(saveTable, nullptr, 0, kProgressCells - 1, 0, 0);
}

void DrawResumeProgress(const UINT8 *saveTable, INT32 firstCell, INT32 lastCell) {
  const INT32 kLastCell = kProgressCells - 1;
  const INT32 first = firstCell < 0 ? 0 : firstCell;
  const INT32 last = lastCell > kLastCell ? kLastCell : lastCell;
  if (first > last) {
    return;
  }
  PaintCells(nullptr, saveTable, static_cast<UINT32>(first), static_cast<UINT32>(last),
             static_cast<UINT32>(lastCell < 0 ? 0 : lastCell), static_cast<UINT32>(last));
}

}  // namespace nimb
