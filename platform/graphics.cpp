#include "graphics.h"

#include "firmware.h"

namespace nimb::platform {

namespace {

constexpr UINT32 kRefreshRate = 60;
constexpr UINT32 kBytesPerPixel = 4;
constexpr UINT64 k4GiB = 0x100000000ULL;

static_assert(sizeof(EFI_UGA_PIXEL) == sizeof(EFI_GRAPHICS_OUTPUT_BLT_PIXEL), "the same pixels");
static_assert(UINT32(EfiUgaVideoFill) == UINT32(EfiBltVideoFill) &&
                  UINT32(EfiUgaVideoToBltBuffer) == UINT32(EfiBltVideoToBltBuffer) &&
                  UINT32(EfiUgaBltBufferToVideo) == UINT32(EfiBltBufferToVideo) &&
                  UINT32(EfiUgaVideoToVideo) == UINT32(EfiBltVideoToVideo),
              "the same operations by number");

EFI_GRAPHICS_OUTPUT_PROTOCOL *GraphicsOf(EFI_UGA_DRAW_PROTOCOL *protocol) {
  return reinterpret_cast<PlatformUgaDraw *>(protocol)->graphics;
}

EFI_STATUS EFIAPI UgaGetMode(EFI_UGA_DRAW_PROTOCOL *This, UINT32 *HorizontalResolution,
                             UINT32 *VerticalResolution, UINT32 *ColorDepth, UINT32 *RefreshRate) {
  if (This == nullptr || HorizontalResolution == nullptr || VerticalResolution == nullptr ||
      ColorDepth == nullptr || RefreshRate == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  const EFI_GRAPHICS_OUTPUT_MODE_INFORMATION *info = GraphicsOf(This)->Mode->Info;
  *HorizontalResolution = info->HorizontalResolution;
  *VerticalResolution = info->VerticalResolution;
  *ColorDepth = GraphicsPixelDepth(*info);
  *RefreshRate = kRefreshRate;
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI UgaSetMode() {
  return EFI_UNSUPPORTED;
}

EFI_STATUS EFIAPI UgaBlt(EFI_UGA_DRAW_PROTOCOL *This, EFI_UGA_PIXEL *BltBuffer,
                         EFI_UGA_BLT_OPERATION BltOperation, UINTN SourceX, UINTN SourceY, UINTN DestinationX,
                         UINTN DestinationY, UINTN Width, UINTN Height, UINTN Delta) {
  if (This == nullptr || BltOperation >= EfiUgaBltMax) {
    return EFI_INVALID_PARAMETER;
  }
  // The graphics output checks the rectangle against the screen.
  EFI_GRAPHICS_OUTPUT_PROTOCOL *graphics = GraphicsOf(This);
  return graphics->Blt(graphics, reinterpret_cast<EFI_GRAPHICS_OUTPUT_BLT_PIXEL *>(BltBuffer),
                       static_cast<EFI_GRAPHICS_OUTPUT_BLT_OPERATION>(BltOperation), SourceX, SourceY,
                       DestinationX, DestinationY, Width, Height, Delta);
}

EFI_STATUS EFIAPI FrameBufferGetInfo(NIMB_FRAME_BUFFER_INFO_PROTOCOL *This,
                                     EFI_PHYSICAL_ADDRESS *FrameBufferBase, UINT32 *FrameBufferSize,
                                     UINT32 *BytesPerRow, UINT32 *Width, UINT32 *Height, UINT32 *Depth) {
  if (This == nullptr || FrameBufferBase == nullptr || FrameBufferSize == nullptr || BytesPerRow == nullptr ||
      Width == nullptr || Height == nullptr || Depth == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  const EFI_GRAPHICS_OUTPUT_PROTOCOL_MODE *mode =
      reinterpret_cast<PlatformFrameBufferInfo *>(This)->graphics->Mode;
  if (!GraphicsFrameBufferUsable(*mode)) {
    return EFI_UNSUPPORTED;
  }
  *FrameBufferBase = mode->FrameBufferBase;
  *FrameBufferSize = static_cast<UINT32>(mode->FrameBufferSize);
  *BytesPerRow = mode->Info->PixelsPerScanLine * kBytesPerPixel;
  *Width = mode->Info->HorizontalResolution;
  *Height = mode->Info->VerticalResolution;
  *Depth = 32;
  return EFI_SUCCESS;
}

PlatformUgaDraw gUgaDraw;
PlatformFrameBufferInfo gFrameBufferInfo;

}  // namespace

UINT32 GraphicsPixelDepth(const EFI_GRAPHICS_OUTPUT_MODE_INFORMATION &info) {
  switch (info.PixelFormat) {
    case PixelRedGreenBlueReserved8BitPerColor:
    case PixelBlueGreenRedReserved8BitPerColor:
      return 32;
    case PixelBitMask: {
      const EFI_PIXEL_BITMASK &masks = info.PixelInformation;
      UINT32 all = masks.RedMask | masks.GreenMask | masks.BlueMask | masks.ReservedMask;
      UINT32 bits = 0;
      for (; all != 0; all >>= 1) {
        bits++;
      }
      return (bits + 7) & ~7U;
    }
    default:
      return 0;
  }
}

bool GraphicsFrameBufferUsable(const EFI_GRAPHICS_OUTPUT_PROTOCOL_MODE &mode) {
  const EFI_GRAPHICS_OUTPUT_MODE_INFORMATION &info = *mode.Info;
  if (info.PixelFormat != PixelBlueGreenRedReserved8BitPerColor || mode.FrameBufferBase == 0 ||
      info.PixelsPerScanLine < info.HorizontalResolution) {
    return false;
  }
  // Every row the loader may write lies inside the buffer, and the buffer
  // below 4 GiB, where the kernel's 32-bit address reaches it.
  const UINT64 rows = static_cast<UINT64>(info.PixelsPerScanLine) * kBytesPerPixel * info.VerticalResolution;
  const UINT64 size = mode.FrameBufferSize;
  return rows <= size && size <= k4GiB && mode.FrameBufferBase <= k4GiB - size;
}

void GraphicsInit(PlatformUgaDraw *uga, PlatformFrameBufferInfo *frameBuffer,
                  EFI_GRAPHICS_OUTPUT_PROTOCOL *graphics) {
  uga->protocol.GetMode = UgaGetMode;
  uga->protocol.SetMode = reinterpret_cast<void *>(UgaSetMode);
  uga->protocol.Blt = UgaBlt;
  uga->graphics = graphics;
  frameBuffer->protocol.GetInfo = FrameBufferGetInfo;
  frameBuffer->graphics = graphics;
}

EFI_STATUS InstallGraphicsProtocols(EFI_SYSTEM_TABLE *st, bool replace) {
  EFI_BOOT_SERVICES *bs = st->BootServices;
  // The console splitter's handle carries the graphics output of all screens.
  void *graphics = nullptr;
  if (st->ConsoleOutHandle == nullptr ||
      EFI_ERROR(bs->HandleProtocol(st->ConsoleOutHandle, &gEfiGraphicsOutputProtocolGuid, &graphics))) {
    if (EFI_ERROR(bs->LocateProtocol(&gEfiGraphicsOutputProtocolGuid, nullptr, &graphics))) {
      graphics = nullptr;
    }
  }
  if (graphics == nullptr) {
    return EFI_UNSUPPORTED;
  }
  GraphicsInit(&gUgaDraw, &gFrameBufferInfo, static_cast<EFI_GRAPHICS_OUTPUT_PROTOCOL *>(graphics));

  // The loader looks for UGA Draw on the console's output handle (only
  // there); without one it goes on a handle of its own, where the loader
  // won't find it.
  ProtocolSlot uga = {st->ConsoleOutHandle, nullptr};
  if (uga.handle != nullptr &&
      !EFI_ERROR(bs->HandleProtocol(uga.handle, &gEfiUgaDrawProtocolGuid, &uga.firmware)) &&
      uga.firmware != nullptr && gOnFirmwareProtocol != nullptr) {
    gOnFirmwareProtocol("UGA Draw", replace);
  }
  if (uga.firmware == nullptr || replace) {
    const EFI_STATUS status = ProtocolPut(uga, gEfiUgaDrawProtocolGuid, &gUgaDraw.protocol);
    if (EFI_ERROR(status)) {
      return status;
    }
  }
  ProtocolSlot info;
  if (!ProtocolClaim(gNimbFrameBufferInfoProtocolGuid, "frame buffer info", replace, &info)) {
    return EFI_SUCCESS;
  }
  if (info.firmware == nullptr) {
    info.handle = uga.handle;
  }
  return ProtocolPut(info, gNimbFrameBufferInfoProtocolGuid, &gFrameBufferInfo.protocol);
}

}  // namespace nimb::platform
