// UGA Draw and the frame buffer info protocol, which the firmware lacks,
// over the firmware's graphics output protocol. The two draw the same way:
// the same Blt operations by number, the same pixels (blue, green, red,
// reserved). The screen is reported with 32 bits per pixel and 60 Hz.
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

// Fills in both protocols over `graphics`.
void GraphicsInit(PlatformUgaDraw *uga, PlatformFrameBufferInfo *frameBuffer,
                  EFI_GRAPHICS_OUTPUT_PROTOCOL *graphics);

// Finds the firmware's graphics output (on the console's output handle, else
// anywhere) and installs UGA Draw on the console's output handle and the
// frame buffer info protocol, where the firmware has none of its own. A
// firmware without graphics output gets neither: EFI_UNSUPPORTED.
EFI_STATUS InstallGraphicsProtocols(EFI_SYSTEM_TABLE *st);

}  // namespace nimb::platform
