// The kernel cache: the kernel with its drivers in one prepared file, named
// by a checksum of the machine's model, the boot device and the kernel's
// name, and valid only exactly one second after the newer of the kernel and
// the extensions directory.
#pragma once

#include "efi/efi.h"
#include "load/kernel_cache_format.h"

namespace nimb {

// The directory of driver bundles, relative to the boot directory; its time
// counts for the kernel cache and the driver package.
inline constexpr const CHAR16 kExtensionsPath[] = u"System\\Library\\Extensions";

// The key whose checksum names the cache file, rebuilt at each try.
extern UINT8 gKernelCacheKey[kCacheKeyBytes];
// The cache file's name: 511 characters and a terminator at most.
extern CHAR16 gKernelCachePath[512];

// Clears gKernelCacheKey and fills it from the model name, gBootDevicePath
// and gKernelName.
void MakeKernelCacheKey();

// Places the kernel of a valid kernel cache at its addresses and sets
// gKernelEntry. `loadFile` is not used: a cache is only read from a volume.
// Any error means that the plain kernel and its drivers are to be loaded.
EFI_STATUS LoadKernelCache(EFI_LOAD_FILE_INTERFACE *loadFile, EFI_FILE *root);

// True when the later record's modification time is exactly the earlier's
// plus one second, all 16 bytes of the time compared.
BOOLEAN IsOneSecondAfter(const EFI_FILE_INFO *earlier, const EFI_FILE_INFO *later);
// Copies the fixed part of the newer record of `a` and `b` (to the second;
// `a` on a tie) to `out`, which may be one of them.
void PickNewerFileInfo(const EFI_FILE_INFO *a, const EFI_FILE_INFO *b, EFI_FILE_INFO *out);

}  // namespace nimb
