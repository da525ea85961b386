// A hostfw firmware with the loader's program-wide state pointed at it, and
// put back to the state of a fresh start after each test.
#pragma once

#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <vector>

#include "boot/boot.h"
#include "boot/stop.h"
#include "config/boot_options.h"
#include "config/plist.h"
#include "devicetree/devicetree.h"
#include "devicetree/platform.h"
#include "hostfw/hostfw.h"
#include "load/bundles.h"
#include "loader_state.h"
#include "memory/kernel_region.h"
#include "memory/tracking.h"
#include "screen/bootscreen.h"
#include "screen/console.h"
#include "screen/spinner.h"
#include "temp_dir.h"

namespace nimbtest {

inline void ResetLoaderState() {
  nimb::gST = nullptr;
  nimb::gBS = nullptr;
  nimb::gRT = nullptr;
  nimb::gImageHandle = nullptr;
  nimb::gLoadedImage = nullptr;
  nimb::gBootDevicePath = nullptr;
  nimb::gCallGate = 0;
  nimb::gKernelEntry = 0;
  nimb::gStopMessage = nullptr;
  nimb::gConsoleControl = nullptr;
  nimb::gConsoleMode = 0;
  nimb::gInitialConsoleMode = 0;
  nimb::gSpinnerEvent = nullptr;
  nimb::gSpinnerPixels = nullptr;
  nimb::gSpinnerFrame = 0;
  nimb::gUgaDraw = nullptr;
  nimb::gScreenWidth = 0;
  nimb::gScreenHeight = 0;
  nimb::gScreenDepth = 0;
  nimb::gFrameBufferBase = 0;
  nimb::gFrameBufferRowBytes = 0;
  nimb::gMemoryTags = nullptr;
  nimb::gFreeMemoryTags = nullptr;
  nimb::gMemoryTagBlocks = nullptr;
  ResetConfigurationState();
  nimb::gDeviceTreeRoot = nullptr;
  nimb::gDeviceTreeNodeCount = 0;
  nimb::gDeviceTreePropertyCount = 0;
  nimb::gDeviceTreeValueBytes = 0;
  nimb::gFreeNodes = nullptr;
  nimb::gNodeBlocks = nullptr;
  nimb::gFreeProperties = nullptr;
  nimb::gPropertyBlocks = nullptr;
  nimb::gKernelRegionTop = 0;
  nimb::gKernelRegionBase = 0xFFFFFFFF;
  nimb::gMemoryMapNode = nullptr;
  nimb::gDriverRecords = nullptr;
  nimb::gLastDriverRecord = nullptr;
  for (char &c : nimb::gModelName)
    c = '\0';
}

// `text` as little-endian UTF-16 bytes, as firmware variables and records hold it.
inline std::vector<uint8_t> Ucs2(const std::u16string &text) {
  std::vector<uint8_t> bytes;
  for (char16_t unit : text)
    bytes.insert(bytes.end(), {uint8_t(unit), uint8_t(unit >> 8)});
  return bytes;
}

// Points the loader's firmware tables at `f` from a fresh start, as BootEntry
// would: for a test or a row with a firmware of its own.
inline void AttachTo(hostfw::Firmware &f) {
  ResetLoaderState();
  nimb::gST = f.SystemTable();
  nimb::gBS = f.BootServices();
  nimb::gRT = f.RuntimeServices();
  nimb::gImageHandle = f.ImageHandle();
}

// Pool blocks from the tracked allocator still held.
inline size_t TrackedPoolBlocks() {
  size_t count = 0;
  for (const nimb::MemoryTag *tag = nimb::gMemoryTags; tag != nullptr; tag = tag->next)
    count += tag->poolAddress != nullptr;
  return count;
}

class LoaderTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ResetLoaderState();
    Attach();
  }
  // What the loader took from `fw` goes back; a row's own firmware is gone.
  void TearDown() override {
    if (nimb::gBS != nullptr && nimb::gBS == fw.BootServices()) {
      nimb::TrackedFreeAll();
    }
    ResetLoaderState();
  }
  // Points the loader's firmware tables at `fw`, as BootEntry would.
  void Attach() {
    nimb::gST = fw.SystemTable();
    nimb::gBS = fw.BootServices();
    nimb::gRT = fw.RuntimeServices();
    nimb::gImageHandle = fw.ImageHandle();
  }
  // Everything the loader took from the firmware has been given back.
  void ExpectNothingHeld() {
    EXPECT_EQ(fw.LivePoolBlocks(), 0u);
    EXPECT_EQ(fw.AllocatedPages(), 0u);
  }

  hostfw::Firmware fw;
};

// A LoaderTest booting from a volume over a fresh host directory: the device
// is the loaded image's, its path the boot device path, and its root open.
class VolumeTest : public LoaderTest {
 protected:
  void SetUp() override {
    LoaderTest::SetUp();
    dir_ = std::make_unique<TempDir>();
    device_ = fw.AddDirectoryVolume(dir_->path());
    fw.SetBootDevice(device_);
    nimb::gLoadedImage = fw.LoadedImage();
    nimb::gBootDevicePath = fw.DevicePathOf(device_);
    EFI_SIMPLE_FILE_SYSTEM_PROTOCOL *fileSystem = nullptr;
    ASSERT_EQ(fw.BootServices()->HandleProtocol(device_, &gEfiSimpleFileSystemProtocolGuid,
                                                reinterpret_cast<void **>(&fileSystem)),
              EFI_SUCCESS);
    ASSERT_EQ(fileSystem->OpenVolume(fileSystem, &root_), EFI_SUCCESS);
  }
  void TearDown() override {
    LoaderTest::TearDown();
    dir_.reset();
  }
  void Put(const std::string &name, const std::string &content) { dir_->File(name, content); }
  void Put(const std::string &name, const std::vector<uint8_t> &bytes) { dir_->File(name, bytes); }

  std::unique_ptr<TempDir> dir_;
  EFI_HANDLE device_ = nullptr;
  EFI_FILE *root_ = nullptr;
};

}  // namespace nimbtest
