// The final hand-off: the rest of the device tree and the boot record, the
// flattened tree and the memory map in the kernel region, the end of boot
// services and the move of the runtime services.
#pragma once

#include "efi/efi.h"

namespace nimb {

// The matching text of a network boot's root device, around the MAC
// address's hex digits.
inline constexpr const char kRootMatchingHead[] =
    "<dict><key>ZoryaProviderClass</key><string>ZoryaNetworkInterface</string><key>ZoryaParentMatch</key>"
    "<dict><key>ZoryaPropertyMatch</key><dict><key>ZoryaMACAddress</key><data format=\"hex\">";
inline constexpr const char kRootMatchingTail[] = "</data></dict></dict></dict>";

// Tries of each read of the memory map.
constexpr int kMemoryMapTries = 4;
// Room added each time a memory map buffer is sized.
constexpr UINTN kMemoryMapMargin = 512;
// Spare pages behind the moved runtime services.
constexpr UINT64 kRuntimeSparePages = 2;

// Completes the tree and the record, leaves boot services and moves the
// runtime services. On return gBS and gRT are null and gST points at the
// moved system table. Always 0.
EFI_STATUS FinishBootInfo(UINTN *mapKey, const char *options);

}  // namespace nimb
