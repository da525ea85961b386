// mkresume_check: puts an image that mkresume wrote on a disk of the host
// firmware, with the NVRAM settings it printed, runs the loader's own
// TryResume, and compares what the loader did with what mkresume meant.
//
// Usage: mkresume_check PARTITION SETTINGS [PLAIN]
// PARTITION and SETTINGS are mkresume's --partition and --nvram-out files,
// PLAIN its --plain-out file. The firmware's FACS signs the machine 0, as
// QEMU's does. The partition's hard-drive node is the one boot-image names.
// Exit status 0 when the loader entered the restart code with the header's
// address and, given PLAIN, the first stage in memory is PLAIN (the fields
// the loader writes left out), the key is gone from NVRAM and from its
// buffer; 2 when the loader reset the machine (it prints which variables
// are left); 1 for anything else.
#include <cstdio>
#include <cstring>
#include <fstream>
#include <iterator>
#include <map>
#include <sstream>
#include <string>
#include <vector>

#include "boot/boot.h"
#include "efi/vendor.h"
#include "hostfw/hostfw.h"
#include "resume/resume.h"
#include "resume/resume_format.h"

namespace {

constexpr UINT64 kPartitionStart = 2048;

std::vector<uint8_t> ReadFile(const std::string &path) {
  std::ifstream in(path, std::ios::binary);
  return std::vector<uint8_t>(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}

// The nvram-hex.NAME=HEX lines of mkresume's settings.
std::map<std::string, std::vector<uint8_t>> ReadSettings(const std::string &path) {
  std::map<std::string, std::vector<uint8_t>> variables;
  std::ifstream in(path);
  std::string line;
  const std::string prefix = "nvram-hex.";
  while (std::getline(in, line)) {
    size_t equals = line.find('=');
    if (line.compare(0, prefix.size(), prefix) != 0 || equals == std::string::npos) {
      continue;
    }
    std::vector<uint8_t> bytes;
    for (size_t i = equals + 1; i + 1 < line.size(); i += 2) {
      bytes.push_back(static_cast<uint8_t>(std::stoi(line.substr(i, 2), nullptr, 16)));
    }
    variables[line.substr(prefix.size(), equals - prefix.size())] = bytes;
  }
  return variables;
}

// The hard-drive node at the head of boot-image, as the host firmware's
// partition is to report it.
bool PartitionNode(const std::vector<uint8_t> &path, hostfw::HardDriveNode *node) {
  if (path.size() < 42 || path[0] != MEDIA_DEVICE_PATH || path[1] != MEDIA_HARDDRIVE_DP) {
    return false;
  }
  std::memcpy(&node->partition, path.data() + 4, 4);
  std::memcpy(node->signature, path.data() + 24, 16);
  node->format = path[40];
  node->signatureType = path[41];
  return true;
}

bool Present(hostfw::Firmware &fw, const CHAR16 *name) {
  return fw.FindVariable(name, gNimbVendorVariableGuid) != nullptr;
}

}  // namespace

int main(int argc, char **argv) {
  if (argc < 3 || argc > 4 || std::strcmp(argv[1], "--help") == 0) {
    std::fprintf(stderr, "Usage: mkresume_check PARTITION SETTINGS [PLAIN]\n");
    return argc == 2 ? 0 : 1;
  }
  std::vector<uint8_t> partition = ReadFile(argv[1]);
  auto settings = ReadSettings(argv[2]);
  std::vector<uint8_t> plain = argc == 4 ? ReadFile(argv[3]) : std::vector<uint8_t>();
  hostfw::HardDriveNode node;
  if (partition.empty() || !PartitionNode(settings["boot-image"], &node)) {
    std::fprintf(stderr, "mkresume_check: no partition image, or no hard-drive node in boot-image\n");
    return 1;
  }

  hostfw::Firmware fw;
  nimb::gST = fw.SystemTable();
  nimb::gBS = fw.BootServices();
  nimb::gRT = fw.RuntimeServices();
  nimb::gImageHandle = fw.ImageHandle();
  hostfw::AcpiOptions acpi;
  acpi.hardwareSignature = 0;
  fw.InstallAcpi(acpi);
  fw.AddScreen();
  const UINT64 blocks = (partition.size() + 511) / 512;
  auto disk = std::make_shared<std::vector<uint8_t>>((kPartitionStart + blocks) * 512, 0);
  std::copy(partition.begin(), partition.end(), disk->begin() + kPartitionStart * 512);
  fw.AddBlockDevice(disk);
  EFI_HANDLE part = fw.AddBlockDevice(disk, 512, kPartitionStart, blocks);
  node.start = kPartitionStart;
  node.blocks = blocks;
  fw.SetHardDrivePath(part, {node});
  constexpr UINT32 kAttributes =
      EFI_VARIABLE_NON_VOLATILE | EFI_VARIABLE_BOOTSERVICE_ACCESS | EFI_VARIABLE_RUNTIME_ACCESS;
  for (const auto &[name, bytes] : settings) {
    fw.PutVariable(std::u16string(name.begin(), name.end()), gNimbVendorVariableGuid, kAttributes, bytes);
  }

  hostfw::RunResult result = fw.Call([] { nimb::TryResume(); });
  std::printf("mkresume_check: variables left: boot-signature %s, boot-image %s, boot-image-key %s\n",
              Present(fw, nimb::kResumeSignatureVariable) ? "yes" : "no",
              Present(fw, nimb::kResumeImageVariable) ? "yes" : "no",
              Present(fw, nimb::kResumeKeyVariable) ? "yes" : "no");
  if (result.end == hostfw::RunEnd::Reset) {
    std::printf("mkresume_check: the loader reset the machine\n");
    return 2;
  }
  if (result.end != hostfw::RunEnd::KernelEntered) {
    std::printf("mkresume_check: the loader neither reset nor entered the restart code\n");
    return 1;
  }
  const auto *header = reinterpret_cast<const nimb::ResumeHeader *>(result.gateArgument);
  const UINT64 entry = (static_cast<UINT64>(header->restorePage) << 12) + header->restoreEntryOffset;
  int failures = 0;
  if (result.gateTarget != entry || Present(fw, nimb::kResumeKeyVariable)) {
    std::printf("mkresume_check: entered 0x%llx (wanted 0x%llx); key variable %s\n",
                static_cast<unsigned long long>(result.gateTarget), static_cast<unsigned long long>(entry),
                Present(fw, nimb::kResumeKeyVariable) ? "left" : "gone");
    failures++;
  }
  if (!plain.empty()) {
    const uint8_t *memory = reinterpret_cast<const uint8_t *>(header);
    size_t wrong = 0, first = 0;
    for (size_t i = 0; i < plain.size(); i++) {
      const bool written = (i >= 0x34 && i < 0x38) || (i >= 0x94 && i < 0xA8);
      if (!written && memory[i] != plain[i] && wrong++ == 0) {
        first = i;
      }
    }
    if (wrong != 0) {
      std::printf("mkresume_check: %zu bytes of the first stage differ, the first at 0x%zx\n", wrong, first);
      failures++;
    }
  }
  std::printf("mkresume_check: restart code entered at 0x%llx with the header at 0x%llx%s\n",
              static_cast<unsigned long long>(entry), static_cast<unsigned long long>(result.gateArgument),
              failures == 0 ? ", first stage as written" : "");
  // Boot services have ended (the loader cleared gBS): what it allocated is
  // the restarted image's now, and goes with the host firmware.
  return failures == 0 ? 0 : 1;
}
