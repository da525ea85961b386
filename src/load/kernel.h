// Loading the kernel image.
#pragma once

#include "efi/efi.h"

namespace nimb {

struct BootFile;

// The processor type of the slice a fat file must hold: 32-bit x86.
constexpr UINT32 kCpuTypeX86 = 7;

// Positions `file` at the start of its 32-bit x86 slice (or at 0 in a file
// that is not fat) and gives the slice's size and offset (each may be null).
EFI_STATUS BootFileFindSlice(BootFile *file, UINT64 *sliceSize, UINT64 *sliceOffset);
// Places the segments of the object file at the position of `file` at their
// addresses in the kernel region and sets gKernelEntry.
EFI_STATUS LoadKernel(BootFile *file);

// Places the kernel named by gKernelName at its addresses and sets
// gKernelEntry. Files come from `loadFile` when it is set, else from `root`.
EFI_STATUS LoadKernelFile(EFI_LOAD_FILE_INTERFACE *loadFile, EFI_FILE *root);

}  // namespace nimb
