// UGA Draw and the frame buffer info protocol, which the firmware lacks,
// over the firmware's graphics output protocol. The two draw the same way:
// the same Blt operations by number, the same pixels (blue, green, red,
// reserved). UGA reports the screen's own depth and 60 Hz; the frame buffer
// info protocol answers only for a frame buffer that the loader and a 32-bit
// kernel can write as they do: 32-bit pixels of blue, green, red, reserved,
// all of it below 4 GiB. Any other screen is drawn through UGA alone.
#pragma once

#include "efi/efi.h"
#include "efi/vendor.h"

namespace nimb::platform {

struct PlatformUgaDraw {
  // First, so that the protocol's `This` is the whole record.
  EFI_UGA_DRAW_PROTOCOL protocol;
  EFI_GRAPHICS_OUTPUT_PROTOCOL *graphics;
};

struct PlatformFrameBufferInfo {
  NIMB_FRAME_BUFFER_INFO_PROTOCOL protocol;
  EFI_GRAPHICS_OUTPUT_PROTOCOL *graphics;
};

// Bits per pixel of a mode's own pixels: 32 for 8 bits per colour, the
// bytes that a bit mask's pixel spans, 0 for a screen drawn only with Blt.
UINT32 GraphicsPixelDepth(const EFI_GRAPHICS_OUTPUT_MODE_INFORMATION &info);

// Whether the frame buffer info protocol tells of `mode`'s frame buffer:
// blue, green, red, reserved in 32 bits, rows of at least the width, every
// row inside the buffer and the whole buffer below 4 GiB. Otherwise its
// GetInfo answers EFI_UNSUPPORTED and writes nothing.
bool GraphicsFrameBufferUsable(const EFI_GRAPHICS_OUTPUT_PROTOCOL_MODE &mode);

// Fills in both protocols over `graphics`.
void GraphicsInit(PlatformUgaDraw *uga, PlatformFrameBufferInfo *frameBuffer,
                  EFI_GRAPHICS_OUTPUT_PROTOCOL *graphics);

// Finds the firmware's graphics output (on the console's output handle, else
// anywhere) and installs UGA Draw on the console's output handle and the
// frame buffer info protocol, where the firmware has none of its own or
// with `replace` in place of the firmware's. A firmware without graphics
// output gets neither: EFI_UNSUPPORTED.
EFI_STATUS InstallGraphicsProtocols(EFI_SYSTEM_TABLE *st, bool replace);

}  // namespace nimb::platform
