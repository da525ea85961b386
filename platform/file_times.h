// Exact modification times for the boot volume. The firmware's FAT keeps
// times in 2-second steps, without nanoseconds; the disk tool lists the
// host files' own times in \EFI\BOOT\platform.times, and the platform layer
// puts a wrapper of the volume's file system on the loader's device whose
// EFI_FILE_INFO answers carry those times. Everything else passes through.
//
// The table is UTF-8 text, one line a path:
//
//   YYYY-MM-DD hh:mm:ss.nnnnnnnnn \path\from\the\root
//
// (UTC; the fraction has one to nine digits). `#` starts a comment line,
// empty lines are skipped. Paths compare without regard to ASCII case, as
// FAT names do. A served time has the time zone unspecified (0x7FF), no
// daylight flag and zero pad bytes, as the firmware's own.
#pragma once

#include "efi/efi.h"

namespace nimb::platform {

struct FileTimeEntry {
  const char *path;  // without its leading backslash, in the table's buffer
  EFI_TIME time;
};

struct FileTimeTable {
  FileTimeEntry *entries;
  UINT32 count;
  UINT32 capacity;
};

// The most units of a path that the wrapper follows; a longer path gets the
// firmware's own times.
constexpr UINTN kMaxTimedPath = 512;

// The number of entries that a table text of `size` bytes can hold at most
// (its lines).
UINT32 FileTimesCapacity(const char *text, UINTN size);

// Parses `size` bytes of `text` into `table`, whose entries have room for
// `table->capacity`. The text is cut up in place and must have room for
// one more byte behind `size`. Returns 0, or the number of the first line
// that is not a valid entry (nothing is added from it on).
UINT32 FileTimesParse(char *text, UINTN size, FileTimeTable *table);

// The table's time of `path` (wide, without a leading backslash, components
// separated by one backslash), or null.
const EFI_TIME *FileTimesFind(const FileTimeTable &table, const CHAR16 *path);

// Joins `name`, as EFI_FILE_PROTOCOL.Open takes it, to the path of the
// directory `base` (both as above; null: unknown, so that only a name from
// the root has a path), into `out` of kMaxTimedPath units:
// a leading backslash starts from the root, "." and empty components are
// dropped, ".." goes up. False when the result does not fit.
bool FileTimesJoin(const CHAR16 *base, const CHAR16 *name, CHAR16 *out);

// Installs the wrapper over the file system of `device` (ReinstallProtocol-
// Interface), serving the times of `table`, which must live as long as the
// platform layer.
EFI_STATUS FileTimesInstall(EFI_HANDLE device, const FileTimeTable *table);

// How many EFI_FILE_INFO answers got a time from the table so far.
UINT64 FileTimesServed();

// Gives `device` the firmware's own file system again, when FileTimesInstall
// wrapped it.
void FileTimesUninstall(EFI_HANDLE device);

}  // namespace nimb::platform
