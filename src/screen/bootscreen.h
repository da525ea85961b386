// The boot screen: the grey screen with the logo, the failure picture, and
// the frame buffer's description for the kernel. All drawing goes through
// the console's UGA Draw protocol.
#pragma once

#include "efi/efi.h"

namespace nimb {

struct BootArgs;

// Screen state. Width, height and depth come from UGA GetMode and from the
// frame buffer info protocol; the last to answer wins.
extern EFI_UGA_DRAW_PROTOCOL *gUgaDraw;
extern UINT32 gScreenWidth;
extern UINT32 gScreenHeight;
extern UINT32 gScreenDepth;      // bits per pixel
extern UINT64 gFrameBufferBase;  // 0: not known
extern UINT32 gFrameBufferRowBytes;

// The frame buffer's facts as the kernel reads them: the layout of the video
// fields of BootArgs. `displayMode` is the caller's to set.
struct VideoInfo {
  UINT32 baseAddress;
  UINT32 displayMode;
  UINT32 rowBytes;
  UINT32 width;
  UINT32 height;
  UINT32 depth;
};
static_assert(sizeof(VideoInfo) == 24, "six 32-bit words");

// BootArgs' videoDisplayMode.
constexpr UINT32 kVideoGraphics = 1;
constexpr UINT32 kVideoText = 2;

// Puts the console in graphics mode, finds UGA Draw on the console's output
// handle, sets kBootGraphics and reads the screen's mode.
EFI_STATUS EnterGraphics();
// The logo (and on a network boot the spinner) if graphics can be had;
// nothing, silently, otherwise.
void ShowBootScreen();
void DrawBootScreen();
// Turns `width` x `height` colour indexes into UGA pixels in a buffer from
// the tracked pool, stored in *pixels. The pixels' reserved bytes are not
// written.
EFI_STATUS ExpandIndexedImage(UINT32 width, UINT32 height, const UINT8 *indexes, EFI_UGA_PIXEL **pixels);
// The grey screen with the failure picture, when the console is in graphics
// mode and UGA Draw is known.
void DrawFailureScreen();
// Fetches the frame buffer's facts once into the globals; writes them to
// `record` (which may be null) when they are known.
void GetFrameBufferInfo(VideoInfo *record);
// The video fields of `bootArgs`, and the colour table and failure picture
// in the kernel region, announced in /chosen/memory-map.
void FillVideoInfo(BootArgs *bootArgs);

// Drawing helpers of the boot screen and the spinner. Blt's result is not
// looked at: drawing never stops a boot.
void FillBackground(UINT32 x, UINT32 y, UINT32 width, UINT32 height);
void DrawPixels(EFI_UGA_PIXEL *pixels, UINT32 x, UINT32 y, UINT32 width, UINT32 height);

}  // namespace nimb
