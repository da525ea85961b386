// kobj_check: loads a kernel object with the loader's own LoadKernelFile
// from a volume of the host firmware, and compares the memory it filled with
// the ELF executable that the object was made from.
//
// Usage: kobj_check INPUT.elf KERNEL
// Exit status 0 when every segment's bytes, the zeroes behind them, the
// kernel region and the entry point are as the ELF file says.
//
// Usage: kobj_check --slice FAT SLICE
// Exit status 0 when the loader's BootFileFindSlice finds in FAT exactly the
// bytes of SLICE (a fat file made by `kobj fat`, read back).
#include <algorithm>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>
#include <vector>

#include "boot/boot.h"
#include "config/boot_options.h"
#include "hostfw/hostfw.h"
#include "kobj/writer.h"
#include "load/bootfile.h"
#include "load/kernel.h"
#include "load/kernel_format.h"
#include "memory/kernel_region.h"
#include "memory/tracking.h"

namespace {

int failures = 0;

void Fail(const std::string &message) {
  std::fprintf(stderr, "kobj_check: %s\n", message.c_str());
  failures++;
}

std::vector<uint8_t> ReadFile(const std::string &path) {
  std::ifstream in(path, std::ios::binary);
  return std::vector<uint8_t>(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}

// The slice that the loader finds in the fat file, against the file it was
// made from.
int CheckSlice(const std::string &fatPath, const std::string &slicePath) {
  std::vector<uint8_t> fat = ReadFile(fatPath);
  std::vector<uint8_t> wanted = ReadFile(slicePath);
  nimb::BootFile file = {};
  file.buffer = fat.data();
  file.size = fat.size();
  UINT64 size = 0;
  UINT64 offset = 0;
  EFI_STATUS status = nimb::BootFileFindSlice(&file, &size, &offset);
  if (status != EFI_SUCCESS) {
    std::fprintf(stderr, "kobj_check: BootFileFindSlice gave 0x%llx for %s\n",
                 static_cast<unsigned long long>(status), fatPath.c_str());
    return 1;
  }
  std::vector<uint8_t> slice(size);
  UINT64 count = size;
  status = nimb::BootFileRead(&file, &count, slice.data());
  if (status != EFI_SUCCESS || count != size || slice != wanted) {
    std::fprintf(stderr, "kobj_check: the slice at 0x%llx, 0x%llx bytes, is not %s\n",
                 static_cast<unsigned long long>(offset), static_cast<unsigned long long>(size),
                 slicePath.c_str());
    return 1;
  }
  std::printf("%s: the x86 slice at 0x%llx is %s\n", fatPath.c_str(), static_cast<unsigned long long>(offset),
              slicePath.c_str());
  return 0;
}

}  // namespace

int main(int argc, char **argv) {
  if (argc == 4 && std::strcmp(argv[1], "--slice") == 0)
    return CheckSlice(argv[2], argv[3]);
  if (argc != 3) {
    std::fprintf(stderr, "Usage: kobj_check INPUT.elf KERNEL\n");
    return 2;
  }
  kobj::Kernel kernel;
  std::string problem = kobj::ReadElf(ReadFile(argv[1]), &kernel);
  if (!problem.empty()) {
    std::fprintf(stderr, "kobj_check: %s: %s\n", argv[1], problem.c_str());
    return 1;
  }

  std::filesystem::path path = std::filesystem::absolute(argv[2]);
  hostfw::Firmware fw;
  nimb::gST = fw.SystemTable();
  nimb::gBS = fw.BootServices();
  nimb::gRT = fw.RuntimeServices();
  nimb::gImageHandle = fw.ImageHandle();
  EFI_HANDLE device = fw.AddDirectoryVolume(path.parent_path().string());
  EFI_SIMPLE_FILE_SYSTEM_PROTOCOL *fileSystem = nullptr;
  EFI_FILE *root = nullptr;
  if (fw.BootServices()->HandleProtocol(device, &gEfiSimpleFileSystemProtocolGuid,
                                        reinterpret_cast<void **>(&fileSystem)) != EFI_SUCCESS ||
      fileSystem->OpenVolume(fileSystem, &root) != EFI_SUCCESS) {
    std::fprintf(stderr, "kobj_check: cannot open the volume over %s\n", path.parent_path().c_str());
    return 1;
  }
  std::u16string name = path.filename().u16string();
  nimb::gKernelName = name.c_str();

  EFI_STATUS status = nimb::LoadKernelFile(nullptr, root);
  if (status != EFI_SUCCESS) {
    std::fprintf(stderr, "kobj_check: LoadKernelFile gave 0x%llx; the console said:\n%s\n",
                 static_cast<unsigned long long>(status), fw.ConOutText().c_str());
    return 1;
  }

  UINT64 base = ~0ULL;
  UINT64 top = 0;
  for (const kobj::Segment &segment : kernel.segments) {
    UINT64 address = segment.address & nimb::kKernelAddressMask;
    UINT64 end = address + ((segment.memorySize + 0xFFFULL) & ~0xFFFULL);
    base = std::min(base, address);
    top = std::max(top, end);
    const uint8_t *memory = reinterpret_cast<const uint8_t *>(address);
    if (!segment.bytes.empty() && std::memcmp(memory, segment.bytes.data(), segment.bytes.size()) != 0)
      Fail("the bytes at " + std::to_string(address) + " differ from the ELF segment's");
    for (UINT64 at = address + segment.bytes.size(); at < end; at++) {
      if (*reinterpret_cast<const uint8_t *>(at) != 0) {
        Fail("byte " + std::to_string(at) + " behind the segment's file bytes is not zero");
        break;
      }
    }
  }
  if (nimb::gKernelRegionBase != base || nimb::gKernelRegionTop != top)
    Fail("kernel region " + std::to_string(nimb::gKernelRegionBase) + ".." +
         std::to_string(nimb::gKernelRegionTop) + ", expected " + std::to_string(base) + ".." +
         std::to_string(top));
  if (nimb::gKernelEntry != (kernel.entry & nimb::kKernelAddressMask))
    Fail("entry " + std::to_string(nimb::gKernelEntry) + ", expected " +
         std::to_string(kernel.entry & nimb::kKernelAddressMask));

  root->Close(root);
  nimb::TrackedFreeAll();
  if (failures == 0)
    std::printf("%s: %zu segments loaded, entry 0x%llx\n", argv[2], kernel.segments.size(),
                static_cast<unsigned long long>(nimb::gKernelEntry));
  return failures == 0 ? 0 : 1;
}
