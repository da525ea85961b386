// Driver bundles: the "*.drvb" directories of the extensions directory. The
// scan keeps those whose property list asks for them at boot, the walk of
// their libraries selects what they need, and the staging places each as
// one block in the kernel region, announced as "Driver-%lx".
#pragma once

#include "efi/efi.h"

namespace nimb {

struct PlistTag;

// Record states.
constexpr UINT8 kDriverNotSelected = 0;
constexpr UINT8 kDriverSelected = 1;  // its libraries not yet walked
constexpr UINT8 kDriverWalked = 2;

// One kept bundle, in tracked pool, kept to the end of the boot.
struct DriverRecord {
  DriverRecord *next;  // in the order of discovery
  UINT8 state;
  PlistTag *dict;          // the top dictionary of its property list
  char *plistText;         // the list as the file has it, with a zero behind
  UINT64 plistLength;      // the file's size plus 1, for that zero
  CHAR16 *executablePath;  // where its code lies, ending in a backslash
};

// The staged block, as the kernel reads it: the header, then the property
// list's text at +16, then the code. Little-endian, addresses of 32 bits.
struct DriverBlockHeader {
  UINT32 plistAddress;
  UINT32 plistLength;        // its terminating zero included
  UINT32 executableAddress;  // 0 without code
  UINT32 executableLength;   // 0 without code
};
static_assert(sizeof(DriverBlockHeader) == 16, "four 32-bit words");

extern DriverRecord *gDriverRecords;
extern DriverRecord *gLastDriverRecord;

// Appends a record for every kept bundle directly in `directory` (and, with
// `recurse`, in the PlugIns of each bundle, one level down). The status of
// the directory's walk.
EFI_STATUS ScanDriverBundles(EFI_FILE *root, const CHAR16 *directory, UINT8 recurse);
// Selects the libraries that the selected records name, until nothing
// changes.
void WalkDriverLibraries();
// Places every selected record in the kernel region, in list order.
void StageDrivers(EFI_FILE *root);

}  // namespace nimb
