// The boot device: the copy of the load options, and the volume and
// directory that all later file names are relative to.
#pragma once

#include "efi/efi.h"

namespace nimb {

// Where files come from: exactly one of the two is non-null.
struct BootVolume {
  EFI_LOAD_FILE_INTERFACE *loadFile;  // network boot
  EFI_FILE *root;                     // file system boot
};

// The three alternative boot directories, tried when the default kernel is
// not in the volume's root.
inline constexpr const char *kBootDirectoryNames[3] = {"com.quill.boot.R", "com.quill.boot.P",
                                                       "com.quill.boot.S"};

// Copies the image's load options into tracked pool without their leading
// blanks and tabs, always terminated; ends the run when there is no memory.
CHAR16 *CopyLoadOptions(const EFI_LOADED_IMAGE_PROTOCOL *image);

// Opens the boot device as a file system (preferred) or a LoadFile device,
// and chooses the root directory; ends the run when neither is there.
BootVolume OpenBootVolume(EFI_HANDLE device);

// Of the three alternative directories (R, P, S) that exist, the index of the
// one to boot from, or -1 when none exists. Of two, the winner is the one
// that follows the other in the ring R, P, S, R; of all three, R.
int ChooseBootDirectory(const bool exists[3]);

}  // namespace nimb
