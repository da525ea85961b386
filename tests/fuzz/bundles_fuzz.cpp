// Any bytes as the Info.plist of a driver bundle and of a bundle nested in
// it: the scan, the walk of the libraries and the staging must stay inside
// their buffers and end; a kept bundle carries the raw text, and every
// staged block describes itself truly.

#include "config/plist.h"
#include "devicetree/devicetree.h"
#include "fuzz_firmware.h"
#include "load/bundles.h"
#include "memory/kernel_region.h"

uint32_t GetLe32(const uint8_t *at) {
  return uint32_t(at[0]) | uint32_t(at[1]) << 8 | uint32_t(at[2]) << 16 | uint32_t(at[3]) << 24;
}

constexpr UINT64 kRegionTop = hostfw::kArenaBase + (8ull << 20);

struct Machine : nimbfuzz::VolumeMachine {
  std::vector<std::string> lists;  // the two Info.plist files on the host
};

Machine &TheMachine() {
  static Machine *machine = [] {
    auto *m = new Machine;
    // A full bundle with a nested flat one; code under the name "a" in both,
    // the nested one a fat file whose slice runs past its end.
    const std::string a = m->directory + "/System/Library/Extensions/A.drvb";
    const std::string b = a + "/Contents/PlugIns/B.drvb";
    std::filesystem::create_directories(a + "/Contents/Tarnix");
    std::filesystem::create_directories(b);
    std::ofstream(a + "/Contents/Tarnix/a") << std::string(100, 'x');
    const uint8_t fat[] = {0xCA, 0xFE, 0xBA, 0xBE, 0, 0, 0, 1, 0, 0, 0, 7, 0, 0, 0,   3,   0,   0,
                           0,    32,   0,    0,    0, 8, 0, 0, 0, 0, 0, 0, 0, 0, 'c', 'o', 'd', 'e'};
    std::ofstream(b + "/a", std::ios::binary).write(reinterpret_cast<const char *>(fat), sizeof(fat));
    m->lists = {a + "/Contents/Info.plist", b + "/Info.plist"};
    return m;
  }();
  return *machine;
}

NIMB_FUZZ_WITHOUT_LEAK_SCAN

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  Machine &m = TheMachine();
  for (const std::string &list : m.lists)
    std::ofstream(list, std::ios::binary | std::ios::trunc)
        .write(reinterpret_cast<const char *>(data), std::streamsize(size));
  nimbfuzz::AttachLoader(m.fw);
  nimb::gPlistFreeTags = nullptr;
  nimb::gPlistSymbols = nullptr;
  nimb::gDriverRecords = nullptr;
  nimb::gLastDriverRecord = nullptr;
  nimb::DeviceTreeInit();
  nimb::gMemoryMapNode = nimb::DeviceTreeFindNode("/chosen/memory-map", 1);
  nimb::gKernelRegionTop = kRegionTop;

  const EFI_STATUS status = nimb::ScanDriverBundles(m.root, u"System\\Library\\Extensions", 1);
  Check(status == EFI_SUCCESS);
  size_t records = 0;
  for (const nimb::DriverRecord *r = nimb::gDriverRecords; r != nullptr; r = r->next, records++) {
    Check(r->state == nimb::kDriverSelected && r->dict != nullptr && r->dict->type == nimb::kPlistDict);
    Check(r->plistLength == size + 1 && std::memcmp(r->plistText, data, size) == 0 &&
          r->plistText[size] == 0);
  }
  Check(records == 0 || records == 2);
  nimb::WalkDriverLibraries();
  nimb::StageDrivers(m.root);

  // Each block lies on its own pages and says where its parts are.
  UINT64 expected = kRegionTop;
  for (const nimb::DeviceTreeProperty *p = nimb::gMemoryMapNode->properties; p != nullptr; p = p->next) {
    if (std::strcmp(p->name, "name") == 0)
      continue;
    const auto *value = static_cast<const uint8_t *>(p->value);
    const UINT64 address = GetLe32(value), length = GetLe32(value + 4);
    Check(address == expected);
    const auto *block = reinterpret_cast<const uint8_t *>(address);
    const uint32_t plistLength = GetLe32(block + 4), codeLength = GetLe32(block + 12);
    Check(GetLe32(block) == address + 16 && plistLength == size + 1);
    Check(std::memcmp(block + 16, data, size) == 0);
    Check(codeLength == 0 ? GetLe32(block + 8) == 0 : GetLe32(block + 8) == address + 16 + plistLength);
    Check(length == 16 + plistLength + codeLength);
    expected = address + ((length + 0xFFF) & ~0xFFFull);
  }
  Check(nimb::gKernelRegionTop == expected);
  Check(m.fw.OpenFiles() == 1);

  nimb::gPlistFreeTags = nullptr;
  nimb::gPlistSymbols = nullptr;
  nimbfuzz::FinishInput(m.fw);
  return 0;
}
