// A hibernated machine on the host firmware: an image built here (header,
// extent list, restart code, preview, the rest of the first stage), spread
// over a partition in extents out of order, and the NVRAM variables that
// ask for its restart.
#pragma once

#include <cstdio>
#include <cstring>
#include <memory>
#include <string>
#include <vector>

#include "efi/vendor.h"
#include "hostfw/hostfw.h"
#include "kernel_images.h"
#include "resume/resume.h"

namespace nimbtest {

struct ResumeImageSpec {
  uint32_t restorePage = 0x400;
  uint32_t restorePageCount = 2;
  uint32_t restoreEntryOffset = 0x20;
  uint32_t runtimePage = 0x480;
  uint32_t runtimePageCount = 16;
  uint32_t previewBytes = 0;
  uint32_t previewPictureOffset = 0;
  uint64_t firstStageBytes = 0x6000;
  uint64_t imageBytes = 0x9000;
  uint64_t encryptedOffset = 0;
  uint64_t machineSignature = 0x4E494D42;  // hostfw's FACS
  // Lengths of the extents in list order; the last one takes what is left
  // of the first stage. The list's own entries are as many as these.
  std::vector<uint64_t> extentLengths = {0x1000, 0x800, 0x2000};
};

// The image's bytes in order, and where its extents lie on the partition.
struct ResumeImage {
  std::vector<uint8_t> bytes;  // the first stage as the loader must see it
  std::vector<nimb::ResumeExtent> extents;
  nimb::ResumeHeader &Header() { return *reinterpret_cast<nimb::ResumeHeader *>(bytes.data()); }
  size_t RestartCodeOffset() { return nimb::kResumeExtentListOffset + Header().extentBytes; }
};

// Builds the first stage with a byte pattern behind the header, and places
// the extents on a partition of `partitionBytes`, last extent first, from
// offset `base` on with a gap of 512 bytes between them.
inline ResumeImage BuildResumeImage(const ResumeImageSpec &spec, uint64_t base = 0x1000) {
  ResumeImage image;
  image.bytes.resize(spec.firstStageBytes);
  for (size_t i = 0; i < image.bytes.size(); i++)
    image.bytes[i] = uint8_t(i * 7 + (i >> 9));
  std::vector<uint64_t> lengths = spec.extentLengths;
  uint64_t listed = 0;
  for (size_t i = 0; i + 1 < lengths.size(); i++)
    listed += lengths[i];
  lengths.back() = spec.firstStageBytes > listed ? spec.firstStageBytes - listed : 0;
  // Last extent lowest on the disk.
  image.extents.resize(lengths.size());
  uint64_t at = base;
  for (size_t i = lengths.size(); i-- > 0;) {
    image.extents[i] = {at, lengths[i]};
    at += (lengths[i] + 511) / 512 * 512 + 512;
  }
  std::memset(image.bytes.data(), 0, nimb::kResumeHeaderBytes);
  nimb::ResumeHeader &h = image.Header();
  h.imageBytes = spec.imageBytes;
  h.firstStageBytes = spec.firstStageBytes;
  h.restorePage = spec.restorePage;
  h.restorePageCount = spec.restorePageCount;
  h.restoreEntryOffset = spec.restoreEntryOffset;
  h.magic = nimb::kResumeMagic;
  h.runtimePage = spec.runtimePage;
  h.runtimePageCount = spec.runtimePageCount;
  h.encryptedOffset = spec.encryptedOffset;
  h.machineSignature = spec.machineSignature;
  h.previewBytes = spec.previewBytes;
  h.previewPictureOffset = spec.previewPictureOffset;
  h.extentBytes = uint32_t(16 * lengths.size());
  std::memset(h.reserved1C, 0x1C, sizeof(h.reserved1C));
  std::memset(h.reservedA8, 0xA8, sizeof(h.reservedA8));
  for (size_t i = 0; i < image.extents.size(); i++) {
    size_t entry = nimb::kResumeExtentListOffset + 16 * i;
    if (entry + 16 <= image.bytes.size())
      std::memcpy(image.bytes.data() + entry, &image.extents[i], 16);
  }
  return image;
}

// The variables: `boot-image` is the partition's hard-drive node (as its
// handle's path has it) and a file-path node holding `offsetText`.
inline std::vector<uint8_t> ResumeImageVariable(const EFI_DEVICE_PATH_PROTOCOL *partitionPath,
                                                const std::u16string &offsetText) {
  std::vector<uint8_t> path;
  const auto *node = reinterpret_cast<const uint8_t *>(partitionPath);
  for (;;) {
    size_t length = node[2] | node[3] << 8;
    if ((node[0] & 0x7F) == MEDIA_DEVICE_PATH && node[1] == MEDIA_HARDDRIVE_DP) {
      path.assign(node, node + length);
      break;
    }
    if ((node[0] & 0x7F) == END_DEVICE_PATH_TYPE || length < 4)
      break;
    node += length;
  }
  std::vector<uint8_t> file = {MEDIA_DEVICE_PATH, MEDIA_FILEPATH_DP, 0, 0};
  for (char16_t unit : offsetText + u'\0') {
    file.push_back(uint8_t(unit));
    file.push_back(uint8_t(unit >> 8));
  }
  file[2] = uint8_t(file.size());
  file[3] = uint8_t(file.size() >> 8);
  path.insert(path.end(), file.begin(), file.end());
  path.insert(path.end(), {END_DEVICE_PATH_TYPE, END_ENTIRE_DEVICE_PATH_SUBTYPE, 4, 0});
  return path;
}

// Reference sum: Adler-32 of each page by itself, the sums added.
inline UINT32 PageSums(const std::vector<uint8_t> &bytes) {
  UINT32 total = 0;
  for (size_t page = 0; page < bytes.size() / 4096; page++)
    total += ReferenceAdler32(bytes.data() + page * 4096, 4096);
  return total;
}

constexpr UINT32 kResumeVariableAttributes =
    EFI_VARIABLE_NON_VOLATILE | EFI_VARIABLE_BOOTSERVICE_ACCESS | EFI_VARIABLE_RUNTIME_ACCESS;

// A disk of 8 MiB whose partition starts at block 2048, with `image` on it,
// and the three variables that ask for its restart.
struct HibernatedMachine {
  std::shared_ptr<std::vector<uint8_t>> disk;
  EFI_HANDLE whole = nullptr;
  EFI_HANDLE partition = nullptr;
  static constexpr uint64_t kPartitionStart = 2048;
  static constexpr uint64_t kPartitionBlocks = 14336;

  void Install(hostfw::Firmware &fw, const ResumeImage &image, const std::vector<uint8_t> &key = {}) {
    disk = std::make_shared<std::vector<uint8_t>>((kPartitionStart + kPartitionBlocks) * 512, 0);
    uint64_t offset = 0;  // the extents, each where it lies on the partition
    for (const nimb::ResumeExtent &extent : image.extents) {
      for (uint64_t i = 0; i < extent.length && offset + i < image.bytes.size(); i++)
        disk->at(kPartitionStart * 512 + extent.start + i) = image.bytes[offset + i];
      offset += extent.length;
    }
    whole = fw.AddBlockDevice(disk);
    partition = fw.AddBlockDevice(disk, 512, kPartitionStart, kPartitionBlocks);
    char hex[32];
    std::snprintf(hex, sizeof(hex), "%llx", static_cast<unsigned long long>(image.extents[0].start));
    std::u16string text(hex, hex + std::strlen(hex));
    fw.PutVariable(nimb::kResumeSignatureVariable, gNimbVendorVariableGuid, kResumeVariableAttributes, {1});
    fw.PutVariable(nimb::kResumeImageVariable, gNimbVendorVariableGuid, kResumeVariableAttributes,
                   ResumeImageVariable(fw.DevicePathOf(partition), text));
    if (!key.empty())
      fw.PutVariable(nimb::kResumeKeyVariable, gNimbVendorVariableGuid, kResumeVariableAttributes, key);
  }
};

}  // namespace nimbtest
