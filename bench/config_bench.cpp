// The boot options step on configuration files of growing size (read,
// parsed, merged), and the property lists of growing numbers of driver
// bundles parsed into one shared symbol list (the parse timed, the freeing
// not), and tracked pool blocks taken and given back: the time per byte stays the same from the smallest to
// the largest, so that no configuration makes the boot slow.
//
// Figures: the rate (bytes per second) at the largest size against the rate
// at the smallest; 1.00x is linear growth, and a cost that grew with the
// square of the size would show as a small fraction.
#include <benchmark/benchmark.h>
#include <stdlib.h>

#include <cstdio>
#include <cstring>
#include <fstream>
#include <memory>
#include <string>
#include <vector>

#include "boot/boot.h"
#include "config/boot_options.h"
#include "config/plist.h"
#include "figures.h"
#include "hostfw/hostfw.h"
#include "memory/tracking.h"

namespace {

// Configuration files of these sizes: distinct keys, and `Kernel Flags`
// of about a fifteenth of the file in distinct words.
constexpr size_t kConfigSizes[] = {256 << 10, 1 << 20, 4 << 20, 8 << 20};
// Driver bundles, each with an Info.plist of its own.
constexpr size_t kBundleCounts[] = {25, 100, 400};
// Tracked pool blocks, all taken and then given back oldest first (the
// farthest from the newest end of the tag list).
constexpr size_t kTrackedBlockCounts[] = {1000, 16000};
constexpr size_t kTrackedBlockSize = 64;

std::string ConfigText(size_t size) {
  std::string flags;
  for (size_t i = 0; flags.size() < size / 15; i++)
    flags += "flag" + std::to_string(i) + "=" + std::to_string(i % 7) + " ";
  std::string text = "<?xml version=\"1.0\"?>\n<plist version=\"1.0\">\n<dict>\n";
  text += "<key>Kernel Flags</key><string>" + flags + "</string>\n";
  for (size_t i = 0; text.size() < size; i++)
    text += "<key>Key" + std::to_string(i) + "</key><string>value " + std::to_string(i) + "</string>\n";
  return text + "</dict>\n</plist>\n";
}

// A driver bundle's description: its own identifier, shared key names.
std::string BundleText(size_t n) {
  const std::string id = "com.example.driver" + std::to_string(n);
  std::string text = "<plist version=\"1.0\"><dict><key>BundleIdentifier</key><string>" + id +
                     "</string><key>BundleVersion</key><string>1." + std::to_string(n % 13) +
                     "</string><key>Personalities</key><dict>";
  for (int p = 0; p < 8; p++) {
    text += "<key>" + id + ".match" + std::to_string(p) + "</key><dict><key>ProviderClass</key><string>Bus" +
            std::to_string(p) + "</string><key>MatchId</key><string>0x" + std::to_string(1000 * n + p) +
            "</string><key>Probe</key><integer>" + std::to_string(p) + "</integer></dict>";
  }
  text += "</dict><key>Libraries</key><dict><key>com.example.kernel</key><string>8.0.0</string>";
  text += "</dict><key>Required</key><string>Root</string></dict></plist>";
  return text;
}

// A host firmware with the loader attached, and a volume over a temporary
// directory that holds the configuration file.
struct Machine {
  hostfw::Firmware fw;
  std::string dir;
  std::string configPath;
  EFI_FILE *root = nullptr;

  Machine() {
    fw.SetConOutPresent(false);
    char pattern[] = "/tmp/nimb-bench-XXXXXX";
    dir = mkdtemp(pattern);
    const std::string configDir = dir + "/Library/Preferences/SystemConfiguration";
    std::system(("mkdir -p '" + configDir + "'").c_str());
    configPath = configDir + "/com.quill.Boot.plist";
    EFI_HANDLE volume = fw.AddDirectoryVolume(dir);
    fw.SetBootDevice(volume);
    EFI_SIMPLE_FILE_SYSTEM_PROTOCOL *fileSystem = nullptr;
    fw.BootServices()->HandleProtocol(volume, &gEfiSimpleFileSystemProtocolGuid,
                                      reinterpret_cast<void **>(&fileSystem));
    fileSystem->OpenVolume(fileSystem, &root);
    nimb::gST = fw.SystemTable();
    nimb::gBS = fw.BootServices();
    nimb::gRT = fw.RuntimeServices();
    nimb::gImageHandle = fw.ImageHandle();
    nimb::gLoadedImage = fw.LoadedImage();
    nimb::gBootDevicePath = fw.DevicePathOf(volume);
  }
  ~Machine() { std::system(("rm -rf '" + dir + "'").c_str()); }

  void WriteConfig(const std::string &text) { std::ofstream(configPath, std::ios::binary) << text; }

  // One boot options step from a clean start; the final option string's
  // length, or 0 when it failed.
  size_t ProcessBootOptions() {
    nimb::gBootFlags = 0;
    nimb::gConfigDict = nullptr;
    nimb::gBootOptions = nullptr;
    nimb::gPlistFreeTags = nullptr;
    nimb::gPlistSymbols = nullptr;
    CHAR16 *options = static_cast<CHAR16 *>(nimb::TrackedAllocatePool(2));
    options[0] = 0;
    size_t length = 0;
    fw.Call([&] {
      if (nimb::ProcessBootOptions(nullptr, root, options, &nimb::gBootOptions) == EFI_SUCCESS)
        length = std::strlen(nimb::gBootOptions);
    });
    nimb::TrackedFreeAll();
    return length;
  }

  // Parses every text into one shared symbol list; the trees.
  std::vector<nimb::PlistTag *> ParseAll(const std::vector<std::string> &texts,
                                         std::vector<std::vector<char>> &work) {
    nimb::gPlistFreeTags = nullptr;
    nimb::gPlistSymbols = nullptr;
    std::vector<nimb::PlistTag *> trees;
    for (size_t i = 0; i < texts.size(); i++) {
      std::memcpy(work[i].data(), texts[i].c_str(), texts[i].size() + 1);
      nimb::PlistTag *dict = nullptr;
      if (nimb::PlistParseDocument(work[i].data(), &dict) == EFI_SUCCESS && dict != nullptr)
        trees.push_back(dict);
    }
    return trees;
  }
  // Gives the trees back, newest first, and then everything else.
  void FreeAll(const std::vector<nimb::PlistTag *> &trees) {
    for (size_t i = trees.size(); i-- > 0;)
      nimb::PlistFreeTag(trees[i]);
    nimb::TrackedFreeAll();
  }
};

Machine &TheMachine() {
  static Machine *machine = new Machine;
  return *machine;
}

void RegisterConfig() {
  for (size_t size : kConfigSizes) {
    benchmark::RegisterBenchmark(("BootOptions/config/" + std::to_string(size)).c_str(),
                                 [size](benchmark::State &state) {
                                   Machine &m = TheMachine();
                                   m.WriteConfig(ConfigText(size));
                                   for (auto _ : state)
                                     benchmark::DoNotOptimize(m.ProcessBootOptions());
                                   state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * size));
                                 })
        ->Unit(benchmark::kMillisecond);
  }
}

void RegisterBundles() {
  for (size_t count : kBundleCounts) {
    benchmark::RegisterBenchmark(("Plist/bundles/" + std::to_string(count)).c_str(),
                                 [count](benchmark::State &state) {
                                   std::vector<std::string> texts;
                                   std::vector<std::vector<char>> work;
                                   size_t bytes = 0;
                                   for (size_t n = 0; n < count; n++) {
                                     texts.push_back(BundleText(n));
                                     work.emplace_back(texts.back().size() + 1);
                                     bytes += texts.back().size();
                                   }
                                   Machine &m = TheMachine();
                                   for (auto _ : state) {
                                     const std::vector<nimb::PlistTag *> trees = m.ParseAll(texts, work);
                                     state.PauseTiming();
                                     m.FreeAll(trees);
                                     state.ResumeTiming();
                                   }
                                   state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * bytes));
                                 })
        ->Unit(benchmark::kMillisecond);
  }
}

void RegisterTracking() {
  for (size_t count : kTrackedBlockCounts) {
    benchmark::RegisterBenchmark(("Tracking/free/" + std::to_string(count)).c_str(), [count](benchmark::State
                                                                                                 &state) {
      TheMachine();
      std::vector<void *> blocks(count);
      for (auto _ : state) {
        for (void *&block : blocks)
          block = nimb::TrackedAllocatePool(kTrackedBlockSize);
        for (void *block : blocks)
          nimb::TrackedFree(block);
        state.PauseTiming();
        nimb::TrackedFreeAll();
        state.ResumeTiming();
      }
      state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * count * kTrackedBlockSize));
    })->Unit(benchmark::kMillisecond);
  }
}

// Before anything is timed: the largest file gives the whole option string
// (every flag word once), and every bundle parses.
bool CheckConfig() {
  Machine &m = TheMachine();
  const size_t largest = kConfigSizes[std::size(kConfigSizes) - 1];
  const std::string text = ConfigText(largest);
  const size_t start = text.find("<string>") + 8;
  const size_t flags = text.find("</string>") - start;
  m.WriteConfig(text);
  const size_t merged = m.ProcessBootOptions();
  if (merged != flags) {
    std::fprintf(stderr, "nimb_bench: the option string has %zu bytes, the flags %zu\n", merged, flags);
    return false;
  }
  std::vector<std::string> texts;
  std::vector<std::vector<char>> work;
  for (size_t n = 0; n < kBundleCounts[0]; n++) {
    texts.push_back(BundleText(n));
    work.emplace_back(texts.back().size() + 1);
  }
  const std::vector<nimb::PlistTag *> trees = m.ParseAll(texts, work);
  m.FreeAll(trees);
  if (trees.size() != texts.size() || nimb::gPlistSymbols != nullptr) {
    std::fprintf(stderr, "nimb_bench: a bundle's description does not parse\n");
    return false;
  }
  return true;
}

BenchSuite config("config", [] {
  if (!CheckConfig())
    return false;
  RegisterConfig();
  RegisterBundles();
  RegisterTracking();
  const std::string smallConfig = std::to_string(kConfigSizes[0]);
  const std::string largeConfig = std::to_string(kConfigSizes[std::size(kConfigSizes) - 1]);
  AddFigure("config-largest-vs-smallest", "BootOptions/config/" + largeConfig,
            "BootOptions/config/" + smallConfig);
  AddFigure("bundles-most-vs-fewest",
            "Plist/bundles/" + std::to_string(kBundleCounts[std::size(kBundleCounts) - 1]),
            "Plist/bundles/" + std::to_string(kBundleCounts[0]));
  AddFigure("tracked-frees-most-vs-fewest",
            "Tracking/free/" + std::to_string(kTrackedBlockCounts[std::size(kTrackedBlockCounts) - 1]),
            "Tracking/free/" + std::to_string(kTrackedBlockCounts[0]));
  return true;
});

}  // namespace
