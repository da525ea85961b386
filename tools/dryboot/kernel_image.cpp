#include "kernel_image.h"

#include <sys/stat.h>

#include <cstring>
#include <fstream>
#include <iterator>

#include "boot/boot.h"
#include "hostfw/hostfw.h"
#include "load/bootfile.h"
#include "load/kernel.h"
#include "load/kernel_format.h"
#include "memory/kernel_region.h"
#include "memory/tracking.h"

namespace dryboot {

namespace {

// A memory file over the image on a firmware of its own, with the loader's
// tables pointed at it while it lives.
class Scratch {
 public:
  explicit Scratch(const std::vector<uint8_t> &bytes) : bytes_(bytes) {
    saved_ = {nimb::gST,
              nimb::gBS,
              nimb::gRT,
              nimb::gKernelRegionBase,
              nimb::gKernelRegionTop,
              nimb::gKernelEntry,
              nimb::gMemoryTags,
              nimb::gFreeMemoryTags,
              nimb::gMemoryTagBlocks};
    fw_.SetConOutPresent(false);
    nimb::gST = fw_.SystemTable();
    nimb::gBS = fw_.BootServices();
    nimb::gRT = fw_.RuntimeServices();
    nimb::gKernelRegionBase = 0xFFFFFFFF;
    nimb::gKernelRegionTop = 0;
    nimb::gMemoryTags = nullptr;
    nimb::gFreeMemoryTags = nullptr;
    nimb::gMemoryTagBlocks = nullptr;
    if (bytes_.empty())
      bytes_.push_back(0);
    file.buffer = bytes_.data();
    file.size = bytes.size();
  }
  ~Scratch() {
    nimb::TrackedFreeAll();
    nimb::gST = saved_.st;
    nimb::gBS = saved_.bs;
    nimb::gRT = saved_.rt;
    nimb::gKernelRegionBase = saved_.base;
    nimb::gKernelRegionTop = saved_.top;
    nimb::gKernelEntry = saved_.entry;
    nimb::gMemoryTags = saved_.tags;
    nimb::gFreeMemoryTags = saved_.freeTags;
    nimb::gMemoryTagBlocks = saved_.tagBlocks;
  }

  hostfw::Firmware fw_;
  std::vector<uint8_t> bytes_;
  nimb::BootFile file = {};

 private:
  struct {
    EFI_SYSTEM_TABLE *st;
    EFI_BOOT_SERVICES *bs;
    EFI_RUNTIME_SERVICES *rt;
    UINT64 base, top, entry;
    nimb::MemoryTag *tags;
    nimb::MemoryTag *freeTags;
    decltype(nimb::gMemoryTagBlocks) tagBlocks;
  } saved_;
};

uint32_t Le32(const std::vector<uint8_t> &bytes, size_t at) {
  uint32_t value = 0;
  for (size_t i = 0; i < 4 && at + i < bytes.size(); i++)
    value |= static_cast<uint32_t>(bytes[at + i]) << (8 * i);
  return value;
}

}  // namespace

KernelImage FindKernelImage(const std::string &volume, const std::string &name) {
  std::string relative = name;
  for (char &c : relative)
    c = c == '\\' ? '/' : c;
  while (!relative.empty() && relative[0] == '/')
    relative.erase(0, 1);
  for (const char *directory : {"", "com.quill.boot.R/", "com.quill.boot.P/", "com.quill.boot.S/"}) {
    const std::string path = volume + "/" + directory + relative;
    struct stat info;
    if (stat(path.c_str(), &info) != 0 || !S_ISREG(info.st_mode))
      continue;
    std::ifstream in(path, std::ios::binary);
    return {path, std::vector<uint8_t>(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>())};
  }
  return {};
}

// Read without the loader's firmware: a second firmware while the first
// lives would take the memory of the boot that is to be looked at.
std::vector<KernelSegment> KernelSegments(const std::vector<uint8_t> &bytes) {
  uint64_t sliceOffset = 0, sliceSize = bytes.size();
  const uint32_t magic = Le32(bytes, 0);
  if (magic == nimb::kFatMagic || magic == nimb::kFatMagicSwapped) {
    // Bytes CA FE BA BE: big-endian records.
    auto word = [&](size_t at) {
      return magic == nimb::kFatMagicSwapped ? __builtin_bswap32(Le32(bytes, at)) : Le32(bytes, at);
    };
    bool found = false;
    for (uint32_t i = 0; i < word(4) && !found && 8 + 20 * (i + 1) <= bytes.size(); i++) {
      const size_t at = 8 + 20 * i;
      found = word(at) == nimb::kCpuTypeX86;
      sliceOffset = word(at + 8);
      sliceSize = word(at + 12);
    }
    if (!found || sliceOffset > bytes.size() || sliceSize > bytes.size() - sliceOffset)
      return {};
  }
  const std::vector<uint8_t> slice(bytes.begin() + sliceOffset, bytes.begin() + sliceOffset + sliceSize);
  std::vector<KernelSegment> segments;
  if (Le32(slice, 0) != nimb::kObjectMagic)
    return segments;
  const uint64_t end =
      std::min<uint64_t>(slice.size(), sizeof(nimb::ObjectHeader) + uint64_t{Le32(slice, 20)});
  for (uint64_t at = sizeof(nimb::ObjectHeader); at + sizeof(nimb::LoadCommand) <= end;) {
    const uint32_t length = Le32(slice, at + 4);
    if (length < sizeof(nimb::LoadCommand))
      break;
    if (Le32(slice, at) == nimb::kLoadCommandSegment && at + sizeof(nimb::SegmentCommand) <= end) {
      segments.push_back(
          {Le32(slice, at + offsetof(nimb::SegmentCommand, address)) & nimb::kKernelAddressMask,
           Le32(slice, at + offsetof(nimb::SegmentCommand, memorySize)),
           Le32(slice, at + offsetof(nimb::SegmentCommand, fileSize))});
    }
    at += length;
  }
  return segments;
}

std::string KernelLoadFailure(const std::vector<uint8_t> &bytes, std::string (*statusText)(uint64_t)) {
  Scratch scratch(bytes);
  EFI_STATUS status = nimb::BootFileFindSlice(&scratch.file, nullptr, nullptr);
  if (status != EFI_SUCCESS)
    return "finding the x86 slice: " + statusText(status);
  status = nimb::LoadKernel(&scratch.file);
  if (status != EFI_SUCCESS)
    return "placing the kernel object: " + statusText(status);
  return "";
}

}  // namespace dryboot
