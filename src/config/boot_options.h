// The boot options: everything that can steer a boot (load options, held
// keys, NVRAM and the configuration file) settled into the mode bits, the
// final option string and the names of the kernel and the driver package.
#pragma once

#include "efi/efi.h"

namespace nimb {

struct PlistTag;

// Bits of gBootFlags. The word only ever gains bits.
constexpr UINT64 kBootSafeMode = 0x01;
constexpr UINT64 kBootVerbose = 0x02;
constexpr UINT64 kBootNetwork = 0x04;
constexpr UINT64 kBootOtherKernel = 0x08;
constexpr UINT64 kBootSingleUser = 0x10;
constexpr UINT64 kBootGraphics = 0x20;
constexpr UINT64 kBootKeysIgnored = 0x40;

// The kernel's default file name, relative to the boot directory, on a boot
// from a volume and over the network.
inline constexpr const CHAR16 kDefaultKernelName[] = u"nimb_kernel";
inline constexpr const CHAR16 kDefaultNetworkKernelName[] = u"nimb.tarnix";
inline constexpr const CHAR16 kDefaultDriverPackageName[] = u"System\\Library\\Extensions.drvpk";
inline constexpr const CHAR16 kDefaultConfigName[] =
    u"Library\\Preferences\\SystemConfiguration\\com.quill.Boot.plist";
inline constexpr const CHAR16 kDefaultNetworkConfigName[] = u"com.quill.Boot.plist";

extern UINT64 gBootFlags;
extern char *gBootOptions;
extern PlistTag *gConfigDict;
extern const CHAR16 *gKernelName;
extern EFI_DEVICE_PATH_PROTOCOL *gKernelDevicePath;
extern const CHAR16 *gDriverPackageName;
extern EFI_DEVICE_PATH_PROTOCOL *gDriverPackagePath;
extern UINT8 gCustomDriverPackage;

// Merges the load options, held keys, NVRAM and the configuration file into
// the final option string (stored in *bootOptions) and settles gBootFlags and
// the names. EFI_OUT_OF_RESOURCES when memory runs out early; the boot goes
// on with the defaults then.
EFI_STATUS ProcessBootOptions(EFI_LOAD_FILE_INTERFACE *loadFile, EFI_FILE *root, const CHAR16 *options,
                              char **bootOptions);

// A tracked copy of the device path in the vendor's NVRAM variable `name`,
// when it is a path over a network device (`wantMac`) or one that is not;
// null otherwise, and for a missing or malformed path.
EFI_DEVICE_PATH_PROTOCOL *GetDevicePathVariable(const CHAR16 *name, BOOLEAN wantMac);

// A tracked copy of `path` up to its first file node, whose name becomes
// `name` (replacing the last component with `replaceLast`, else added to its
// end), with an end node behind it; null when the path has no file node.
EFI_DEVICE_PATH_PROTOCOL *MakeFileDevicePath(const EFI_DEVICE_PATH_PROTOCOL *path, const CHAR16 *name,
                                             BOOLEAN replaceLast);

}  // namespace nimb
