// The screen: UGA Draw over an in-memory frame buffer, and the vendor's
// frame buffer info protocol that tells where that memory lies. Both sit on
// the console's output handle, as on the machines the loader was made for.
#include <cstring>

#include "efi/vendor.h"
#include "hostfw/internal.h"

namespace hostfw {

// The protocol records come first in their wrappers, so that a service
// finds its screen from `This`.
struct UgaObject {
  EFI_UGA_DRAW_PROTOCOL protocol;
  Screen *screen;
};

struct FrameBufferInfoObject {
  NIMB_FRAME_BUFFER_INFO_PROTOCOL protocol;
  Screen *screen;
};

struct Screen {
  UgaObject uga;
  FrameBufferInfoObject frameBufferInfo;
  EFI_HANDLE handle;
  ScreenOptions options;
  UINT32 bytesPerPixel;
  UINT32 rowBytes;
  UINT64 base;  // the pixels, in the arena
  FrameBufferFacts reported;
  std::vector<BltCall> blts;
};

namespace {

Screen &ScreenOf(const std::shared_ptr<Screen> &screen) {
  if (screen == nullptr)
    Misuse("the screen is used before AddScreen");
  return *screen;
}

UINT8 *PixelAddress(const Screen &screen, UINTN x, UINTN y) {
  return reinterpret_cast<UINT8 *>(screen.base) + y * screen.rowBytes + x * screen.bytesPerPixel;
}

void PutPixel(const Screen &screen, UINTN x, UINTN y, const EFI_UGA_PIXEL &pixel) {
  UINT8 *at = PixelAddress(screen, x, y);
  if (screen.bytesPerPixel == 4) {
    std::memcpy(at, &pixel, 4);
  } else {
    const UINT16 packed = UINT16((pixel.Red >> 3) << 10 | (pixel.Green >> 3) << 5 | (pixel.Blue >> 3));
    std::memcpy(at, &packed, 2);
  }
}

EFI_STATUS EFIAPI UgaGetMode(EFI_UGA_DRAW_PROTOCOL *This, UINT32 *HorizontalResolution,
                             UINT32 *VerticalResolution, UINT32 *ColorDepth, UINT32 *RefreshRate) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "UgaGetMode", &failure))
    return failure;
  if (This == nullptr || HorizontalResolution == nullptr || VerticalResolution == nullptr ||
      ColorDepth == nullptr || RefreshRate == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  const Screen &screen = *reinterpret_cast<UgaObject *>(This)->screen;
  *HorizontalResolution = screen.options.width;
  *VerticalResolution = screen.options.height;
  *ColorDepth = screen.options.depth;
  *RefreshRate = screen.options.refresh;
  return EFI_SUCCESS;
}

EFI_STATUS UgaBltOn(Screen &screen, EFI_UGA_PIXEL *BltBuffer, EFI_UGA_BLT_OPERATION BltOperation,
                    UINTN SourceX, UINTN SourceY, UINTN DestinationX, UINTN DestinationY, UINTN Width,
                    UINTN Height, UINTN Delta) {
  if (BltOperation != EfiUgaVideoFill && BltOperation != EfiUgaBltBufferToVideo)
    return BltOperation < EfiUgaBltMax ? EFI_UNSUPPORTED : EFI_INVALID_PARAMETER;
  if (BltBuffer == nullptr || Width == 0 || Height == 0)
    return EFI_INVALID_PARAMETER;
  // The rectangle must lie on the screen, without wrapping round.
  const UINTN screenWidth = screen.options.width, screenHeight = screen.options.height;
  if (DestinationX >= screenWidth || Width > screenWidth - DestinationX || DestinationY >= screenHeight ||
      Height > screenHeight - DestinationY) {
    return EFI_INVALID_PARAMETER;
  }
  if (BltOperation == EfiUgaVideoFill) {
    for (UINTN y = 0; y < Height; y++) {
      for (UINTN x = 0; x < Width; x++)
        PutPixel(screen, DestinationX + x, DestinationY + y, *BltBuffer);
    }
    return EFI_SUCCESS;
  }
  const UINTN stride = Delta != 0 ? Delta : Width * sizeof(EFI_UGA_PIXEL);
  const auto *source = reinterpret_cast<const UINT8 *>(BltBuffer);
  for (UINTN y = 0; y < Height; y++) {
    const auto *row = reinterpret_cast<const EFI_UGA_PIXEL *>(source + (SourceY + y) * stride) + SourceX;
    for (UINTN x = 0; x < Width; x++)
      PutPixel(screen, DestinationX + x, DestinationY + y, row[x]);
  }
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI UgaBlt(EFI_UGA_DRAW_PROTOCOL *This, EFI_UGA_PIXEL *BltBuffer,
                         EFI_UGA_BLT_OPERATION BltOperation, UINTN SourceX, UINTN SourceY, UINTN DestinationX,
                         UINTN DestinationY, UINTN Width, UINTN Height, UINTN Delta) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "UgaBlt", &failure))
    return failure;
  if (This == nullptr)
    return EFI_INVALID_PARAMETER;
  Screen &screen = *reinterpret_cast<UgaObject *>(This)->screen;
  const EFI_STATUS status = UgaBltOn(screen, BltBuffer, BltOperation, SourceX, SourceY, DestinationX,
                                     DestinationY, Width, Height, Delta);
  BltCall call = {BltOperation, SourceX, SourceY, DestinationX, DestinationY,
                  Width,        Height,  Delta,   {},           status};
  if (BltOperation == EfiUgaVideoFill && BltBuffer != nullptr)
    call.fill = *BltBuffer;
  screen.blts.push_back(call);
  return status;
}

EFI_STATUS EFIAPI UgaSetMode() {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "UgaSetMode", &failure))
    return failure;
  return EFI_UNSUPPORTED;
}

EFI_STATUS EFIAPI FrameBufferGetInfo(NIMB_FRAME_BUFFER_INFO_PROTOCOL *This,
                                     EFI_PHYSICAL_ADDRESS *FrameBufferBase, UINT32 *FrameBufferSize,
                                     UINT32 *BytesPerRow, UINT32 *Width, UINT32 *Height, UINT32 *Depth) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "FrameBufferGetInfo", &failure))
    return failure;
  if (This == nullptr || FrameBufferBase == nullptr || FrameBufferSize == nullptr || BytesPerRow == nullptr ||
      Width == nullptr || Height == nullptr || Depth == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  const FrameBufferFacts &facts = reinterpret_cast<FrameBufferInfoObject *>(This)->screen->reported;
  *FrameBufferBase = facts.base;
  *FrameBufferSize = facts.size;
  *BytesPerRow = facts.rowBytes;
  *Width = facts.width;
  *Height = facts.height;
  *Depth = facts.depth;
  return EFI_SUCCESS;
}

}  // namespace

void Firmware::AddScreen(const ScreenOptions &options) {
  if (options.depth != 32 && options.depth != 16)
    Misuse("a screen of %u bits per pixel", options.depth);
  if (options.width == 0 || options.height == 0)
    Misuse("a screen of %u x %u pixels", options.width, options.height);
  if (screen_ != nullptr) {
    SetUgaDrawPresent(false);
    SetFrameBufferInfoPresent(false);
  }
  auto screen = std::make_shared<Screen>();
  screen->options = options;
  screen->bytesPerPixel = options.depth / 8;
  screen->rowBytes = options.rowBytes != 0 ? options.rowBytes : options.width * screen->bytesPerPixel;
  if (screen->rowBytes < options.width * screen->bytesPerPixel)
    Misuse("rows of %u bytes for %u pixels", screen->rowBytes, options.width);
  const UINT64 bytes = UINT64(screen->rowBytes) * options.height;
  // A real frame buffer is memory-mapped I/O; the map says so here too.
  screen->base = AllocateFirmwarePages(*s_, EfiMemoryMappedIO, EFI_SIZE_TO_PAGES(bytes), 0);
  screen->uga.protocol.GetMode = UgaGetMode;
  screen->uga.protocol.SetMode = reinterpret_cast<void *>(UgaSetMode);
  screen->uga.protocol.Blt = UgaBlt;
  screen->uga.screen = screen.get();
  screen->frameBufferInfo.protocol.GetInfo = FrameBufferGetInfo;
  screen->frameBufferInfo.screen = screen.get();
  screen->handle = s_->conOutHandle;
  screen_ = screen;
  screen_->reported = ScreenFacts();
  SetUgaDrawPresent(options.ugaDraw);
  SetFrameBufferInfoPresent(options.frameBufferInfo);
}

void Firmware::SetUgaDrawPresent(bool present) {
  Screen &screen = ScreenOf(screen_);
  if (present) {
    PutInterface(*s_, screen.handle, gEfiUgaDrawProtocolGuid, &screen.uga.protocol);
  } else {
    UninstallProtocol(screen.handle, gEfiUgaDrawProtocolGuid);
  }
}

void Firmware::SetFrameBufferInfoPresent(bool present) {
  Screen &screen = ScreenOf(screen_);
  if (present) {
    PutInterface(*s_, screen.handle, gNimbFrameBufferInfoProtocolGuid, &screen.frameBufferInfo.protocol);
  } else {
    UninstallProtocol(screen.handle, gNimbFrameBufferInfoProtocolGuid);
  }
}

FrameBufferFacts Firmware::ScreenFacts() const {
  const Screen &screen = ScreenOf(screen_);
  FrameBufferFacts facts;
  facts.base = screen.base;
  facts.size = screen.rowBytes * screen.options.height;
  facts.rowBytes = screen.rowBytes;
  facts.width = screen.options.width;
  facts.height = screen.options.height;
  facts.depth = screen.options.depth;
  return facts;
}

void Firmware::SetFrameBufferFacts(const FrameBufferFacts &facts) {
  ScreenOf(screen_).reported = facts;
}

UINT32 Firmware::ScreenPixel(UINT32 x, UINT32 y) const {
  const Screen &screen = ScreenOf(screen_);
  if (x >= screen.options.width || y >= screen.options.height)
    Misuse("pixel (%u, %u) is off the screen", x, y);
  UINT32 value = 0;
  std::memcpy(&value, PixelAddress(screen, x, y), screen.bytesPerPixel);
  return value;
}

const std::vector<BltCall> &Firmware::BltCalls() const {
  return ScreenOf(screen_).blts;
}

}  // namespace hostfw
