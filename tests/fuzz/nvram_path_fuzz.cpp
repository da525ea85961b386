// Any bytes as a device path variable from NVRAM, as the boot options read
// "efi-boot-file-data": what GetDevicePathVariable accepts must be walkable,
// measurable and copyable inside the variable's own pool block, and a file
// path made from it must end inside its own block too.
//
// Input: one byte of flags (bit 0 wantMac, bit 1 replace the last file node),
// then the variable's bytes.

#include "config/boot_options.h"
#include "efi/vendor.h"
#include "fuzz_firmware.h"
#include "support/devicepath.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  if (size == 0)
    return 0;
  static hostfw::Firmware &fw = nimbfuzz::Quiet(*new hostfw::Firmware);
  nimbfuzz::AttachLoader(fw);
  const bool wantMac = (data[0] & 1) != 0;
  const bool replace = (data[0] & 2) != 0;
  const std::vector<uint8_t> value(data + 1, data + size);
  fw.PutVariable(u"efi-boot-file-data", gNimbVendorVariableGuid, 7, value);

  EFI_DEVICE_PATH_PROTOCOL *path = nimb::GetDevicePathVariable(u"efi-boot-file-data", wantMac);
  if (path != nullptr) {
    const UINTN pathSize = nimb::DevicePathSize(path);
    Check(pathSize != 0 && pathSize <= value.size());
    Check((nimb::DevicePathFindNode(path, pathSize, MESSAGING_DEVICE_PATH, MSG_MAC_ADDR_DP) != nullptr) ==
          wantMac);
    EFI_DEVICE_PATH_PROTOCOL *copy = nimb::DuplicateDevicePath(path);
    Check(copy != nullptr && nimb::DevicePathSize(copy) == pathSize);
    nimb::gBS->FreePool(copy);
    for (const CHAR16 *name : {u"nimb.tarnix", u".drvpk", u""}) {
      EFI_DEVICE_PATH_PROTOCOL *made = nimb::MakeFileDevicePath(path, name, replace);
      if (made != nullptr) {
        Check(nimb::DevicePathSize(made) != 0);
        nimb::TrackedFree(made);
      }
    }
  }
  nimbfuzz::FinishInput(fw, false);
  return 0;
}
