// A hostfw firmware with the loader's program-wide state pointed at it, and
// put back to the state of a fresh start after each test.
#pragma once

#include <gtest/gtest.h>

#include <string>

#include "boot/boot.h"
#include "boot/stop.h"
#include "config/boot_options.h"
#include "config/plist.h"
#include "devicetree/devicetree.h"
#include "devicetree/platform.h"
#include "hostfw/hostfw.h"
#include "memory/kernel_region.h"
#include "memory/tracking.h"
#include "screen/bootscreen.h"
#include "screen/console.h"
#include "screen/spinner.h"

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
  nimb::gBootFlags = 0;
  nimb::gBootOptions = nullptr;
  nimb::gConfigDict = nullptr;
  nimb::gKernelName = nullptr;
  nimb::gKernelDevicePath = nullptr;
  nimb::gDriverPackageName = nullptr;
  nimb::gDriverPackagePath = nullptr;
  nimb::gCustomDriverPackage = 0;
  nimb::gPlistFreeTags = nullptr;
  nimb::gPlistSymbols = nullptr;
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
  for (char &c : nimb::gModelName)
    c = '\0';
}

class LoaderTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ResetLoaderState();
    Attach();
  }
  void TearDown() override {
    if (nimb::gBS != nullptr) {
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

}  // namespace nimbtest
