// The boot configuration's program-wide state, put back to that of a fresh
// start: for the unit tests and for fuzz targets that keep one firmware
// across inputs.
#pragma once

#include "config/boot_options.h"
#include "config/plist.h"

namespace nimbtest {

inline void ResetConfigurationState() {
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
  nimb::gPlistSymbolIndex = {};
}

}  // namespace nimbtest
