// Fault injection over whole boots: each kind of boot runs once to count the
// firmware calls and allocations it makes, then once per allocation with it
// refused and once per call of each service with that call failed. A boot
// either still enters the kernel or ends through Exit(EFI_ABORTED) after a
// message, with the console mode restored and every byte given back; a
// resume enters the image, resets, or (before it has taken anything) goes
// back to the normal boot. Nothing touches boot services after they end.
#include <gtest/gtest.h>

#include <cstdio>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "hostfw/network.h"
#include "kcache/cache_writer.h"
#include "kernel_images.h"
#include "loader_fixture.h"
#include "resume/resume.h"
#include "resume_scene.h"
#include "support/devicepath.h"

namespace {

using nimbtest::Bytes;

constexpr char kExtensions[] = "System/Library/Extensions";
constexpr int64_t kTime = 1199145599;  // 2007-12-31 23:59:59
// Calls swept per service (and allocations per boot) at most; the first and
// the last are always among them.
constexpr unsigned kSamples = 12;

// One run's firmware, the loader's tables on it, and what it boots from.
struct Scene : nimbtest::ResumeScene {
  Scene() : ResumeScene(false) {}
  std::unique_ptr<hostfw::NetworkDevice> net;
};

struct Kind {
  const char *name;
  bool resume;
  std::function<void(Scene &)> arrange;
};

struct Fault {
  std::string service;  // empty: the n-th allocation
  unsigned nth;
};

std::vector<unsigned> Sample(unsigned count) {
  std::vector<unsigned> picks;
  const unsigned step = count > kSamples ? (count + kSamples - 1) / kSamples : 1;
  for (unsigned n = 1; n <= count; n += step)
    picks.push_back(n);
  if (count > 0 && picks.back() != count)
    picks.push_back(count);
  return picks;
}

class FaultSweep : public ::testing::Test {
 protected:
  void TearDown() override { nimbtest::ResetLoaderState(); }

  static hostfw::RunResult Run(Scene &scene, const Kind &kind) {
    return kind.resume ? scene.fw.Call([] { nimb::TryResume(); }) : scene.fw.Run(BootEntry);
  }

  // Runs `kind` with `fault` injected and checks the outcome; returns how
  // it ended.
  static hostfw::RunEnd Check(const Kind &kind, const Fault &fault) {
    Scene scene;
    scene.fw.SetConsoleMode(EfiConsoleControlScreenGraphics);
    kind.arrange(scene);
    if (fault.service.empty())
      scene.fw.FailAllocation(fault.nth);
    else
      scene.fw.FailCall(fault.service, fault.nth);
    const hostfw::RunResult result = Run(scene, kind);
    hostfw::Firmware &fw = scene.fw;
    const std::string what = std::string(kind.name) + ": " +
                             (fault.service.empty() ? "allocation" : fault.service) + " #" +
                             std::to_string(fault.nth);
    SCOPED_TRACE(what);
    const std::string text = fw.ConOutText();
    EXPECT_EQ(fw.ViolationsAfterExit(), std::vector<std::string>{}) << text;
    // A refused free or mode change is the firmware's doing, not a loss.
    const bool gaveBack = fault.service == "FreePool" || fault.service == "FreePages" ||
                          fw.AllocatedPages() + fw.LivePoolBlocks() == 0;
    const bool requestKept =
        fw.FindVariable(nimb::kResumeSignatureVariable, gNimbVendorVariableGuid) != nullptr;
    switch (result.end) {
      case hostfw::RunEnd::KernelEntered:
        EXPECT_TRUE(fw.BootServicesExited());
        break;
      case hostfw::RunEnd::Exited:
        // A resume has one fatal message, for tracking without tags.
        EXPECT_EQ(text, kind.resume ? "Can't allocate memory tag" : text);
        EXPECT_EQ(result.status, EFI_ABORTED) << text;
        EXPECT_FALSE(text.empty());
        EXPECT_TRUE(fault.service == "SetMode" || fw.ConsoleMode() == EfiConsoleControlScreenGraphics)
            << text;
        EXPECT_TRUE(gaveBack) << text;
        break;
      case hostfw::RunEnd::Halted:
        // A failure past ExitBootServices: the stop that needs no firmware.
        EXPECT_TRUE(fw.BootServicesExited() && nimb::gStopMessage != nullptr);
        break;
      case hostfw::RunEnd::Reset:
        EXPECT_TRUE(kind.resume && result.resetType == EfiResetCold && !requestKept) << text;
        break;
      case hostfw::RunEnd::Returned:
        // Back to the normal boot: only a resume that never saw its request.
        EXPECT_TRUE(kind.resume && requestKept && gaveBack) << text;
        break;
      default:
        ADD_FAILURE() << "ended as " << static_cast<int>(result.end) << "\n" << text;
    }
    return result.end;
  }

  void Sweep(const Kind &kind) {
    SCOPED_TRACE(kind.name);
    std::map<std::string, unsigned> counts;
    unsigned allocations = 0;
    {
      Scene scene;
      scene.fw.SetConsoleMode(EfiConsoleControlScreenGraphics);
      kind.arrange(scene);
      const std::map<std::string, unsigned> before = scene.fw.CallCounts();
      const hostfw::RunResult result = Run(scene, kind);
      ASSERT_EQ(result.end, hostfw::RunEnd::KernelEntered) << scene.fw.ConOutText();
      for (const auto &[service, count] : scene.fw.CallCounts()) {
        auto it = before.find(service);
        counts[service] = count - (it == before.end() ? 0 : it->second);
      }
      allocations = counts["AllocatePool"] + counts["AllocatePages"];
    }
    // The run's own ends are not faults it can meet, nor can a service
    // without a status fail.
    for (const char *service : {"Exit", "ResetSystem", "CopyMem", "SetMem"})
      counts.erase(service);
    unsigned runs = 0, entered = 0, calls = 0;
    std::vector<Fault> faults;
    for (unsigned n : Sample(allocations))
      faults.push_back({"", n});
    for (const auto &[service, count] : counts) {
      calls += count;
      for (unsigned n : Sample(count))
        faults.push_back({service, n});
    }
    for (const Fault &fault : faults) {
      runs++;
      entered += Check(kind, fault) == hostfw::RunEnd::KernelEntered;
      if (HasFatalFailure())
        return;
    }
    std::printf("%s: %u calls of %zu services, %u allocations; %u runs, %u entered\n", kind.name, calls,
                counts.size(), allocations, runs, entered);
    // Some faults hit optional sources only, and some are fatal.
    EXPECT_GT(entered, 0u);
    EXPECT_LT(entered, runs);
  }
};

Bytes Kernel() {
  return nimbtest::Object{
      0xFEEDFACE,
      {nimbtest::Segment(0x200000, 0x1000, nimbtest::kObjectDataStart, 0x1000), nimbtest::Thread(0x200010)},
      nimbtest::Pattern(0x1000)}
      .Build();
}

// A volume with the kernel and one bundle with an executable; with `cache`
// also a valid kernel cache for it.
std::function<void(Scene &)> DiskVolume(nimbtest::TempDir &dir, bool cache) {
  return [&dir, cache](Scene &scene) {
    hostfw::Firmware &fw = scene.fw;
    fw.AddScreen();
    EFI_HANDLE device = fw.AddDirectoryVolume(dir.path());
    fw.SetBootDevice(device);
    fw.SetFileTime(dir.path() + "/nimb_kernel", kTime);
    fw.SetFileTime(dir.path() + "/" + kExtensions, kTime);
    if (cache) {
      const EFI_DEVICE_PATH_PROTOCOL *path = fw.DevicePathOf(device);
      const auto *bytes = reinterpret_cast<const uint8_t *>(path);
      const kcache::CacheKey key =
          kcache::MakeCacheKey("ACPI", Bytes(bytes, bytes + nimb::DevicePathSize(path)), "nimb_kernel");
      const std::string name = kcache::CacheFileName(key);
      dir.File(name, kcache::WriteCache(Kernel(), key, true));
      fw.SetFileTime(dir.path() + "/" + name, kTime + 1);
    }
  };
}

TEST_F(FaultSweep, EveryFailureOfEveryKindOfBoot) {
  nimbtest::TempDir plain, cached;
  for (nimbtest::TempDir *dir : {&plain, &cached}) {
    dir->File("nimb_kernel", Kernel());
    dir->File(std::string(kExtensions) + "/A.drvb/Info.plist",
              "<dict><key>VzBundleRequired</key><string>Root</string>"
              "<key>VzBundleExecutable</key><string>a</string></dict>");
    dir->File(std::string(kExtensions) + "/A.drvb/a", nimbtest::Pattern(100));
  }
  const Kind kinds[] = {
      {"disk, plain kernel and bundles", false, DiskVolume(plain, false)},
      {"disk, kernel cache", false, DiskVolume(cached, true)},
      {"network", false,
       [](Scene &scene) {
         scene.fw.AddScreen();
         scene.net = std::make_unique<hostfw::NetworkDevice>(scene.fw);
         scene.net->PutFile(u"EFI\\BOOT\\nimb.tarnix", Kernel());
         scene.net->PutFile(u"EFI\\BOOT\\nimb.tarnix.drvpk", nimbtest::Pattern(0x100));
         scene.fw.SetBootDevice(scene.net->Handle());
       }},
      {"resume", true,
       [](Scene &scene) {
         scene.fw.AddScreen();
         scene.fw.InstallAcpi({});
         scene.Install(nimbtest::ThreePageSpec());
       }},
  };
  for (const Kind &kind : kinds)
    Sweep(kind);
}

}  // namespace
