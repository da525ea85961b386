#include "load/kernel.h"

#include "boot/boot.h"
#include "config/boot_options.h"
#include "load/bootfile.h"
#include "load/kernel_format.h"
#include "memory/kernel_region.h"
#include "memory/tracking.h"
#include "screen/console.h"
#include "support/strings.h"

namespace nimb {

// The largest block of load commands believed. A kernel's commands take a
// few hundred bytes; the bound keeps a lying header from asking for the
// whole pool.
constexpr UINT32 kMaxCommandsSize = 0x100000;

// Segments end at or below this address: addresses cross to the kernel as
// 32-bit words.
constexpr UINT64 kAddressLimit = 0x100000000ULL;

static UINT32 Swap32(UINT32 value) {
  return (value >> 24) | ((value >> 8) & 0xFF00) | ((value << 8) & 0xFF0000) | (value << 24);
}

// Reads exactly `size` bytes: a read error is returned as it is, fewer bytes
// give EFI_LOAD_ERROR.
static EFI_STATUS ReadRecord(BootFile *file, void *record, UINT64 size) {
  UINT64 count = size;
  EFI_STATUS status = BootFileRead(file, &count, record);
  if (EFI_ERROR(status)) {
    return status;
  }
  return count == size ? EFI_SUCCESS : EFI_LOAD_ERROR;
}

EFI_STATUS BootFileFindSlice(BootFile *file, UINT64 *sliceSize, UINT64 *sliceOffset) {
  FatHeader header;
  EFI_STATUS status = ReadRecord(file, &header, sizeof(header));
  if (EFI_ERROR(status)) {
    return status;
  }
  UINT64 size = 0;
  UINT64 offset = 0;
  if (header.magic == kFatMagic || header.magic == kFatMagicSwapped) {
    bool swap = header.magic == kFatMagicSwapped;
    UINT32 slices = swap ? Swap32(header.sliceCount) : header.sliceCount;
    // A count beyond the file ends at the first short read.
    for (UINT32 i = 0; i < slices; i++) {
      FatSlice slice;
      status = ReadRecord(file, &slice, sizeof(slice));
      if (EFI_ERROR(status)) {
        return status;
      }
      UINT32 cpuType = swap ? Swap32(slice.cpuType) : slice.cpuType;
      if (cpuType == kCpuTypeX86) {
        offset = swap ? Swap32(slice.offset) : slice.offset;
        size = swap ? Swap32(slice.size) : slice.size;
        break;
      }
    }
    // The slice is given as declared. A slice that runs past the end of
    // the file is no lie to be refused here: its reads come short, and each
    // caller knows what a short read means (a package is not found, a
    // driver's code is staged short, a segment is cleared). No read or write
    // goes beyond the file or the caller's buffer.
  } else {
    status = BootFileSetPosition(file, 0);
    if (EFI_ERROR(status)) {
      printf("Couldn't set position back to 0.\n");
      return status;
    }
    status = BootFileGetSize(file, &size);
    if (EFI_ERROR(status)) {
      return status;
    }
  }
  if (size == 0) {
    return EFI_LOAD_ERROR;
  }
  if (offset != 0) {
    status = BootFileSetPosition(file, offset);
    if (EFI_ERROR(status)) {
      return status;
    }
  }
  if (sliceSize != nullptr) {
    *sliceSize = size;
  }
  if (sliceOffset != nullptr) {
    *sliceOffset = offset;
  }
  return EFI_SUCCESS;
}

// The slice that the commands describe.
struct Slice {
  BootFile *file;
  UINT64 offset;
  UINT64 size;
};

// Checks a segment command against the slice and, with `place` set, puts
// its bytes at its address in the kernel region.
static EFI_STATUS LoadSegment(const Slice &slice, const SegmentCommand &segment, bool place) {
  if (segment.fileSize == 0) {
    // A segment without file bytes is stepped over, however large.
    return EFI_SUCCESS;
  }
  UINT64 address = segment.address & kKernelAddressMask;
  UINT64 roundedSize = EFI_SIZE_TO_PAGES(static_cast<UINT64>(segment.memorySize)) << EFI_PAGE_SHIFT;
  // More file bytes than the segment's pages would be written past them.
  if (segment.fileSize > roundedSize) {
    return EFI_LOAD_ERROR;
  }
  // Pages that run past 4 GiB cannot be handed to the kernel.
  if (address + roundedSize > kAddressLimit) {
    return EFI_LOAD_ERROR;
  }
  // A segment whose bytes begin outside the slice points at another
  // slice's bytes or at no file at all.
  if (segment.fileOffset > slice.size) {
    return EFI_LOAD_ERROR;
  }
  if (!place) {
    return EFI_SUCCESS;
  }

  UINT64 size = segment.memorySize;
  if (AllocateKernelPages(&address, &size) == 0) {
    return EFI_OUT_OF_RESOURCES;
  }
  EFI_STATUS status = BootFileSetPosition(slice.file, slice.offset + segment.fileOffset);
  if (EFI_ERROR(status)) {
    printf("Set offset failed\n");
    return status;
  }
  // Bytes that run past the end of the slice are not read: the segment's
  // data ends there, as in a file that ends early.
  UINT64 got = segment.fileSize;
  if (got > slice.size - segment.fileOffset) {
    got = slice.size - segment.fileOffset;
  }
  status = BootFileRead(slice.file, &got, reinterpret_cast<void *>(address));
  if (EFI_ERROR(status)) {
    printf("Read file failed: status %d, buffer size 0x%x\n", status, got);
    return status;
  }
  // The zero-initialised tail, the slack of the last page, and whatever a
  // short read left out.
  if (got < size) {
    gBS->SetMem(reinterpret_cast<void *>(address + got), size - got, 0);
  }
  if (size != 0) {
    if (address < gKernelRegionBase) {
      gKernelRegionBase = address;
    }
    if (address + size > gKernelRegionTop) {
      gKernelRegionTop = address + size;
    }
  }
  return EFI_SUCCESS;
}

// Walks the load commands in file order. Without `place` it only checks
// them, so that a file that lies is refused before anything is placed; with
// `place` it loads the segments and gives the entry of the last thread
// command (0 without one).
static EFI_STATUS WalkCommands(const Slice &slice, const UINT8 *commands, UINT32 commandsSize,
                               UINT32 commandCount, bool place, UINT64 *entry) {
  UINT64 entryValue = 0;
  UINT32 offset = 0;
  for (UINT32 i = 0; i < commandCount; i++) {
    // Every command opens with its type and length, inside the block.
    if (commandsSize - offset < sizeof(LoadCommand)) {
      return EFI_LOAD_ERROR;
    }
    LoadCommand opening;
    memcpy(&opening, commands + offset, sizeof(opening));
    // A length below the opening would stand still or walk backwards; one
    // past the block would take bytes that are no command.
    if (opening.commandLength < sizeof(LoadCommand) || opening.commandLength > commandsSize - offset) {
      return EFI_LOAD_ERROR;
    }
    if (opening.command == kLoadCommandSegment) {
      // The fields read must lie inside the command.
      if (opening.commandLength < sizeof(SegmentCommand)) {
        return EFI_LOAD_ERROR;
      }
      SegmentCommand segment;
      memcpy(&segment, commands + offset, sizeof(segment));
      EFI_STATUS status = LoadSegment(slice, segment, place);
      if (EFI_ERROR(status)) {
        return status;
      }
    } else if (opening.command == kLoadCommandThread) {
      // The entry word must lie inside the command.
      if (opening.commandLength < offsetof(ThreadCommand, entry) + sizeof(UINT32)) {
        return EFI_LOAD_ERROR;
      }
      UINT32 word;
      memcpy(&word, commands + offset + offsetof(ThreadCommand, entry), sizeof(word));
      entryValue = word;
    }
    offset += opening.commandLength;
  }
  *entry = entryValue;
  return EFI_SUCCESS;
}

EFI_STATUS LoadKernel(BootFile *file) {
  Slice slice = {file, 0, 0};
  EFI_STATUS status = BootFileFindSlice(file, &slice.size, &slice.offset);
  if (EFI_ERROR(status)) {
    return status;
  }
  ObjectHeader header;
  status = ReadRecord(file, &header, sizeof(header));
  if (EFI_ERROR(status)) {
    return status;
  }
  if (header.magic != kObjectMagic) {
    ErrorPrintf("Nimb-O file has bad magic number 0x%x\n", static_cast<UINT64>(header.magic));
    return EFI_LOAD_ERROR;
  }
  // The commands must fit the slice behind the header, and the buffer for
  // them must stay small whatever the header claims.
  if (header.commandsSize > kMaxCommandsSize || slice.size < sizeof(header) ||
      header.commandsSize > slice.size - sizeof(header)) {
    return EFI_LOAD_ERROR;
  }
  // Every command takes at least its opening: a negative count, or one that
  // the commands cannot hold, is no count at all.
  INT32 commandCount = static_cast<INT32>(header.commandCount);
  if (commandCount < 0 || static_cast<UINT32>(commandCount) > header.commandsSize / sizeof(LoadCommand)) {
    return EFI_LOAD_ERROR;
  }

  UINT8 *commands = static_cast<UINT8 *>(TrackedAllocatePool(header.commandsSize));
  if (commands == nullptr) {
    Fatal("Out of memory in LoadKernel\n");
  }
  UINT64 count = header.commandsSize;
  status = BootFileRead(file, &count, commands);
  if (EFI_ERROR(status) || count != header.commandsSize) {
    TrackedFree(commands);
    return EFI_LOAD_ERROR;
  }
  UINT64 entry = 0;
  status = WalkCommands(slice, commands, header.commandsSize, commandCount, false, &entry);
  if (!EFI_ERROR(status)) {
    status = WalkCommands(slice, commands, header.commandsSize, commandCount, true, &entry);
  }
  TrackedFree(commands);
  if (EFI_ERROR(status)) {
    return status;
  }
  gKernelEntry = entry & kKernelAddressMask;
  return EFI_SUCCESS;
}

EFI_STATUS LoadKernelFile(EFI_LOAD_FILE_INTERFACE *loadFile, EFI_FILE *root) {
  // Boot options that could not be settled leave no name to print or open.
  if (gKernelName == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  printf("Loading '%S'...\n", gKernelName);
  BootFile file;
  if (gKernelDevicePath != nullptr) {
    BootFileOpenDevicePath(loadFile, gKernelDevicePath, &file);
  } else {
    EFI_STATUS status = BootFileOpen(loadFile, root, gKernelName, &file);
    if (EFI_ERROR(status)) {
      printf("Could not open file '%S'\n", gKernelName);
      return status;
    }
  }
  EFI_STATUS status = LoadKernel(&file);
  BootFileClose(&file);
  return status;
}

}  // namespace nimb
