// The whole of ProcessBootOptions on the host firmware, from a volume or
// over the network, with fuzzed load options, NVRAM values and configuration
// file: it must end, stay inside what it read, leave a final option string
// and names it can stand behind, and hold nothing but what it hands on.
//
// Input: one byte of flags (bit 0 network boot, bits 1-3 which of
// "boot-args", "efi-boot-file-data", "efi-boot-drvpk-data" exist), then the
// load options, the three variables' values, each of a length the input
// gives, and the rest as the configuration file.

#include "boot/volume.h"
#include "config/boot_options.h"
#include "config/plist.h"
#include "efi/vendor.h"
#include "fuzz_firmware.h"
#include "hostfw/network.h"
#include "tests/unit/loader_state.h"

struct Machine : nimbfuzz::VolumeMachine {
  hostfw::NetworkDevice net{fw};
  std::string configPath = directory + "/Library/Preferences/SystemConfiguration";

  Machine() {
    std::filesystem::create_directories(configPath);
    configPath += "/com.quill.Boot.plist";
  }
};

void SetVariable(hostfw::Firmware &fw, const char16_t *name, bool present, const std::string &value) {
  fw.RuntimeServices()->SetVariable(const_cast<CHAR16 *>(name), &gNimbVendorVariableGuid, 7, 0, nullptr);
  if (present)
    fw.PutVariable(name, gNimbVendorVariableGuid, 7, std::vector<uint8_t>(value.begin(), value.end()));
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  static Machine &m = *new Machine;
  hostfw::Firmware &fw = m.fw;
  nimbfuzz::AttachLoader(fw);
  nimbtest::ResetConfigurationState();

  FuzzedDataProvider input(data, size);
  const uint8_t flags = input.ConsumeIntegral<uint8_t>();
  const bool network = (flags & 1) != 0;
  const std::string options = input.ConsumeRandomLengthString(4096);
  fw.SetLoadOptionsBytes(std::vector<uint8_t>(options.begin(), options.end()));
  SetVariable(fw, u"boot-args", flags & 2, input.ConsumeRandomLengthString(4096));
  SetVariable(fw, u"efi-boot-file-data", flags & 4, input.ConsumeRandomLengthString(1024));
  SetVariable(fw, u"efi-boot-drvpk-data", flags & 8, input.ConsumeRandomLengthString(1024));
  const std::vector<uint8_t> config = input.ConsumeRemainingBytes<uint8_t>();

  EFI_LOAD_FILE_INTERFACE *loadFile = nullptr;
  EFI_FILE *root = nullptr;
  if (network) {
    m.net.PutFile(u"com.quill.Boot.plist", config);
    fw.SetBootDevice(m.net.Handle());
    loadFile = m.net.Protocol();
  } else {
    FILE *file = std::fopen(m.configPath.c_str(), "wb");
    Check(file != nullptr);
    std::fwrite(config.data(), 1, config.size(), file);
    std::fclose(file);
    fw.SetBootDevice(m.device);
    root = m.root;
  }
  nimb::gLoadedImage = fw.LoadedImage();
  nimb::gBootDevicePath = fw.DevicePathOf(network ? m.net.Handle() : m.device);

  EFI_STATUS status = EFI_ABORTED;
  const hostfw::RunResult run = fw.Call([&] {
    CHAR16 *copied = nimb::CopyLoadOptions(nimb::gLoadedImage);
    status = nimb::ProcessBootOptions(loadFile, root, copied, &nimb::gBootOptions);
  });
  Check(run.end == hostfw::RunEnd::Returned);
  if (status == EFI_SUCCESS) {
    Check(nimb::gBootOptions != nullptr && std::strlen(nimb::gBootOptions) < (1u << 24));
    Check(nimb::gKernelName != nullptr && nimb::gDriverPackageName != nullptr);
  }
  Check(network == ((nimb::gBootFlags & nimb::kBootNetwork) != 0));

  nimbfuzz::FinishInput(fw, false);
  return 0;
}
