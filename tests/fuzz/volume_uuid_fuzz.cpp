// Any bytes as a volume: the header at byte 1024 (and an embedded volume's
// header wherever a wrapper points) read by GetVolumeUuidFromHeader. The
// text goes into a buffer of exactly the size given, and is either a whole
// UUID or nothing.
//
// Input: one byte of text buffer size, then the volume's bytes from 1024 on.

#include "devicetree/volume_uuid.h"
#include "fuzz_firmware.h"

constexpr size_t kVolumeBytes = 64 * 1024;

struct Machine {
  hostfw::Firmware fw;
  std::shared_ptr<std::vector<uint8_t>> image = std::make_shared<std::vector<uint8_t>>(kVolumeBytes);
  EFI_HANDLE device = fw.AddBlockDevice(image);
};

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  if (size == 0)
    return 0;
  static Machine *m = new Machine;
  nimbfuzz::AttachLoader(m->fw);
  std::fill(m->image->begin(), m->image->end(), 0);
  std::memcpy(m->image->data() + 1024, data + 1, std::min(size - 1, kVolumeBytes - 1024));

  const size_t textSize = data[0] % (nimb::kUuidTextSize + 4);
  std::unique_ptr<char[]> text(new char[textSize + 1]);
  const EFI_STATUS status = nimb::GetVolumeUuidFromHeader(m->device, textSize, text.get());
  if (status == EFI_SUCCESS) {
    Check(textSize >= nimb::kUuidTextSize && std::strlen(text.get()) == nimb::kUuidTextSize - 1);
  }
  nimbfuzz::FinishInput(m->fw, false);
  return 0;
}
