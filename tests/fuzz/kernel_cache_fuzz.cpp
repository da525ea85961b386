// Any bytes as a kernel cache file on a volume whose kernel and extensions
// make it stand at the right time: the header checks, the decompression and
// the load of the kernel inside must stay inside their buffers and end, and
// everything but the kernel's pages must come back at once.
//
// The first byte of an input is no part of the file: its bits ask for the
// header to be made consistent with the file, so that the search reaches
// the decompression (bit 0: compressedSize), the checksum (bit 1:
// uncompressedSize) and the kernel inside (bit 2: adler32).

#include "config/boot_options.h"
#include "devicetree/platform.h"
#include "fuzz_firmware.h"
#include "load/kernel_cache.h"
#include "load/lzss.h"
#include "memory/kernel_region.h"
#include "support/checksum.h"

// Sizes in the header are kept below this, so that no input has the pool
// asked for a gigabyte.
constexpr uint32_t kSizeMask = 0x000FFFFF;

void PutBe32(uint8_t *at, uint32_t value) {
  for (int i = 0; i < 4; i++)
    at[i] = static_cast<uint8_t>(value >> (24 - 8 * i));
}

uint32_t GetBe32(const uint8_t *at) {
  return uint32_t(at[0]) << 24 | uint32_t(at[1]) << 16 | uint32_t(at[2]) << 8 | at[3];
}

struct Machine : nimbfuzz::VolumeMachine {
  std::string cachePath;  // on the host
};

// The loader's state of a disk boot just before the kernel is loaded.
void Prepare(Machine &m) {
  nimbfuzz::AttachLoader(m.fw);
  nimb::gBootDevicePath = m.fw.DevicePathOf(m.device);
  nimb::gKernelName = u"nimb_kernel";
  nimb::gBootFlags = 0;
  nimb::gCustomDriverPackage = 0;
  nimb::gConfigDict = nullptr;
  nimb::gKernelRegionBase = 0xFFFFFFFF;
  nimb::gKernelRegionTop = 0;
  nimb::gKernelEntry = 0x5EED;
}

Machine &TheMachine() {
  static Machine *machine = [] {
    auto *m = new Machine;
    std::ofstream(m->directory + "/nimb_kernel") << "k";
    const std::string extensions = m->directory + "/System/Library/Extensions";
    std::filesystem::create_directories(extensions);
    std::filesystem::create_directories(m->directory + "/System/Library/Caches/com.quill.kernelcaches");
    // The first try names the file.
    Prepare(*m);
    std::strcpy(nimb::gModelName, "FuzzBox1,1");
    Check(EFI_ERROR(nimb::LoadKernelCache(nullptr, m->root)));
    nimb::TrackedFreeAll();
    for (const CHAR16 *c = nimb::gKernelCachePath; *c != 0; c++)
      m->cachePath.push_back(*c == u'\\' ? '/' : static_cast<char>(*c));
    m->cachePath = m->directory + "/" + m->cachePath;
    const int64_t time = 1199145599;  // 2007-12-31 23:59:59
    m->fw.SetFileTime(m->directory + "/nimb_kernel", time);
    m->fw.SetFileTime(extensions, time);
    m->fw.SetFileTime(m->cachePath, time + 1);
    return m;
  }();
  return *machine;
}

NIMB_FUZZ_WITHOUT_LEAK_SCAN

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  if (size == 0)
    return 0;
  Machine &m = TheMachine();
  Prepare(m);
  const uint8_t mode = data[0];
  std::vector<uint8_t> file(data + 1, data + size);
  if (file.size() >= 384) {
    uint8_t *header = file.data();
    const uint32_t compressedSize = mode & 1 ? uint32_t(file.size() - 384) : GetBe32(header + 16);
    PutBe32(header + 16, compressedSize & kSizeMask);
    PutBe32(header + 12, GetBe32(header + 12) & kSizeMask);
    if (mode & 6) {
      static std::vector<uint8_t> decoded(kSizeMask + 1);
      const uint64_t length = nimb::DecompressLzss(decoded.data(), decoded.size(), file.data() + 384,
                                                   uint32_t(file.size() - 384));
      if (mode & 2)
        PutBe32(header + 12, uint32_t(length));
      if (mode & 4) {
        const uint32_t checksum = nimb::Adler32(decoded.data(), length);
        std::memcpy(header + 8, &checksum, 4);
      }
    }
  }
  std::ofstream(m.cachePath, std::ios::binary | std::ios::trunc)
      .write(reinterpret_cast<const char *>(file.data()), std::streamsize(file.size()));

  const EFI_STATUS status = nimb::LoadKernelCache(nullptr, m.root);
  if (status == EFI_SUCCESS) {
    Check(nimb::gKernelEntry <= 0x3FFFFFFF);
    Check(nimb::gKernelRegionTop <= 0x100000000ull);
  } else {
    Check(status == EFI_NOT_FOUND || status == EFI_DEVICE_ERROR || status == EFI_LOAD_ERROR ||
          status == EFI_OUT_OF_RESOURCES || status == EFI_INVALID_PARAMETER);
  }
  // The file, the info records and the data buffers went back: only the
  // kernel's pages are held, and only the root is open.
  for (const nimb::MemoryTag *tag = nimb::gMemoryTags; tag != nullptr; tag = tag->next)
    Check(tag->poolAddress == nullptr);
  Check(m.fw.OpenFiles() == 1);
  nimbfuzz::FinishInput(m.fw);
  return 0;
}
