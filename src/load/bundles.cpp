#include "load/bundles.h"

#include "config/plist.h"
#include "load/bootfile.h"
#include "load/kernel.h"
#include "memory/kernel_region.h"
#include "memory/tracking.h"
#include "screen/console.h"
#include "support/sprint.h"
#include "support/strings.h"

namespace nimb {

DriverRecord *gDriverRecords;
DriverRecord *gLastDriverRecord;

// Every path of a bundle is made in a buffer of this many bytes; a longer
// one is cut, and its open decides.
constexpr UINTN kBundlePathBytes = 2048;
// A directory entry: the info record and a name of up to 511 characters.
constexpr UINTN kBundleInfoBytes = 1104;

constexpr CHAR16 kBundleSuffix[] = u".drvb";
constexpr UINT64 kBundleSuffixUnits = sizeof(kBundleSuffix) / sizeof(CHAR16) - 1;

// Both words of a block's header that hold a length or an address are 32
// bits wide: a block must end below this.
constexpr UINT64 kBlockLimit = 0x100000000ULL;

static bool IsBundleName(const CHAR16 *name) {
  UINT64 length = StrLen(name);
  if (length < kBundleSuffixUnits) {
    return false;
  }
  const CHAR16 *tail = name + length - kBundleSuffixUnits;
  for (UINT64 i = 0; i < kBundleSuffixUnits; i++) {
    if (tail[i] != kBundleSuffix[i]) {
      return false;
    }
  }
  return true;
}

static bool CanOpen(EFI_FILE *root, const CHAR16 *path) {
  EFI_FILE *handle = nullptr;
  if (EFI_ERROR(root->Open(root, &handle, path, EFI_FILE_MODE_READ, 0))) {
    return false;
  }
  handle->Close(handle);
  return true;
}

// The property list of a bundle as read: a tracked buffer of `size` + 1
// bytes, zeroed behind what came; null when it cannot be had.
static char *ReadBundleList(EFI_FILE *root, const CHAR16 *path, const CHAR16 *bundle, UINT64 *size) {
  BootFile file;
  if (EFI_ERROR(BootFileOpen(nullptr, root, path, &file))) {
    return nullptr;
  }
  char *text = nullptr;
  if (EFI_ERROR(BootFileGetSize(&file, size))) {
    printf("Error getting file size\n");
  } else if (*size < kBlockLimit - 1) {
    text = static_cast<char *>(TrackedAllocatePool(*size + 1));
  }
  if (text != nullptr) {
    UINT64 count = *size;
    if (EFI_ERROR(BootFileRead(&file, &count, text))) {
      printf("Error reading file %S\n", bundle);
      TrackedFree(text);
      text = nullptr;
    } else {
      if (count != *size) {
        printf("Hey, got read of %d != expected %d\n", count, *size);
      }
      // What a short read left out reads as zeroes, the terminator among them.
      bzero(text + count, *size + 1 - count);
    }
  }
  BootFileClose(&file);
  return text;
}

// Makes a record of the bundle `bundle` in `directory` when its property
// list asks for it; a bundle that cannot be read or is not kept leaves the
// list as it was.
static void ScanBundle(EFI_FILE *root, const CHAR16 *directory, const CHAR16 *bundle, bool full) {
  CHAR16 *path = static_cast<CHAR16 *>(TrackedAllocatePool(kBundlePathBytes));
  if (path == nullptr) {
    return;
  }
  SPrint(path, kBundlePathBytes, u"%S\\%S\\%S", directory, bundle, full ? u"Contents\\Tarnix\\" : u"");
  UINT64 prefixBytes = (StrLen(path) + 1) * sizeof(CHAR16);
  CHAR16 *prefix = static_cast<CHAR16 *>(TrackedAllocatePool(prefixBytes));
  char *text = nullptr;
  char *copy = nullptr;
  PlistTag *dict = nullptr;
  DriverRecord *record = nullptr;
  UINT64 size = 0;
  if (prefix != nullptr) {
    memcpy(prefix, path, prefixBytes);
    SPrint(path, kBundlePathBytes, u"%S\\%S\\%SInfo.plist", directory, bundle, full ? u"Contents\\" : u"");
    text = ReadBundleList(root, path, bundle, &size);
  }
  if (text != nullptr) {
    // The parser cuts the text it reads: the block gets an untouched copy.
    copy = static_cast<char *>(TrackedAllocatePool(size + 1));
  }
  if (copy != nullptr) {
    memcpy(copy, text, size + 1);
    PlistParseDocument(text, &dict);
  }
  const PlistTag *required = PlistFindKey(dict, "VzBundleRequired");
  if (required != nullptr && required->type == kPlistString && required->text != nullptr &&
      strcmp(required->text, "Safe Boot") != 0) {
    record = static_cast<DriverRecord *>(TrackedAllocatePool(sizeof(DriverRecord)));
  }
  if (record != nullptr) {
    bzero(record, sizeof(*record));
    record->state = kDriverSelected;
    record->dict = dict;
    record->plistText = copy;
    record->plistLength = size + 1;
    record->executablePath = prefix;
    if (gLastDriverRecord != nullptr) {
      gLastDriverRecord->next = record;
    } else {
      gDriverRecords = record;
    }
    gLastDriverRecord = record;
  } else {
    PlistFreeTag(dict);
    void *held[] = {copy, prefix};
    for (void *block : held) {
      if (block != nullptr) {
        TrackedFree(block);
      }
    }
  }
  if (text != nullptr) {
    TrackedFree(text);
  }
  TrackedFree(path);
}

EFI_STATUS ScanDriverBundles(EFI_FILE *root, const CHAR16 *directory, UINT8 recurse) {
  if (root == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  CHAR16 *path = static_cast<CHAR16 *>(TrackedAllocatePool(kBundlePathBytes));
  if (path == nullptr) {
    return EFI_OUT_OF_RESOURCES;
  }
  EFI_FILE *handle = nullptr;
  EFI_STATUS status = root->Open(root, &handle, directory, EFI_FILE_MODE_READ, 0);
  if (EFI_ERROR(status)) {
    TrackedFree(path);
    return status;
  }
  EFI_FILE_INFO *info = static_cast<EFI_FILE_INFO *>(TrackedAllocatePool(kBundleInfoBytes));
  if (info == nullptr) {
    Fatal("Couldn't allocate file info structure\n");
  }
  CHAR16 *lastUnit = reinterpret_cast<CHAR16 *>(reinterpret_cast<UINT8 *>(info) + kBundleInfoBytes) - 1;
  for (;;) {
    UINTN size = kBundleInfoBytes;
    status = handle->Read(handle, &size, info);
    if (EFI_ERROR(status) || size == 0) {
      break;
    }
    // The name ends within the buffer, whatever the firmware wrote.
    *lastUnit = 0;
    if ((info->Attribute & EFI_FILE_DIRECTORY) == 0 || !IsBundleName(info->FileName)) {
      continue;
    }
    SPrint(path, kBundlePathBytes, u"%S\\%S\\Contents", directory, info->FileName);
    const bool full = CanOpen(root, path);
    ScanBundle(root, directory, info->FileName, full);
    if (recurse) {
      // One level down and no further; a bundle without PlugIns fails
      // there quietly.
      SPrint(path, kBundlePathBytes, u"%S\\%S\\%SPlugIns", directory, info->FileName,
             full ? u"Contents\\" : u"");
      ScanDriverBundles(root, path, 0);
    }
  }
  handle->Close(handle);
  TrackedFree(info);
  TrackedFree(path);
  return status;
}

// The first record whose bundle identifier is `identifier`.
static DriverRecord *FindDriverRecord(const char *identifier) {
  for (DriverRecord *record = gDriverRecords; record != nullptr; record = record->next) {
    const PlistTag *tag = PlistFindKey(record->dict, "VzBundleIdentifier");
    if (tag != nullptr && tag->text != nullptr && strcmp(tag->text, identifier) == 0) {
      return record;
    }
  }
  return nullptr;
}

void WalkDriverLibraries() {
  bool selected = true;
  while (selected) {
    selected = false;
    for (DriverRecord *record = gDriverRecords; record != nullptr; record = record->next) {
      if (record->state != kDriverSelected) {
        continue;
      }
      selected = true;
      const PlistTag *libraries = PlistFindKey(record->dict, "VzBundleLibraries");
      if (libraries != nullptr && libraries->type == kPlistDict) {
        for (const PlistTag *child = libraries->child; child != nullptr; child = child->next) {
          DriverRecord *library = child->text != nullptr ? FindDriverRecord(child->text) : nullptr;
          if (library != nullptr && library->state == kDriverNotSelected) {
            library->state = kDriverSelected;
          }
        }
      }
      record->state = kDriverWalked;
    }
  }
}

// Places one record as a block at the top of the kernel region. A code file
// that cannot be opened, sized or sliced leaves the record out.
static void StageDriver(EFI_FILE *root, const DriverRecord *record, CHAR16 *path) {
  BootFile file;
  bool open = false;
  UINT64 codeSize = 0;
  const PlistTag *executable = PlistFindKey(record->dict, "VzBundleExecutable");
  if (executable != nullptr) {
    SPrint(path, kBundlePathBytes, u"%S%a", record->executablePath, executable->text);
    if (EFI_ERROR(BootFileOpen(nullptr, root, path, &file))) {
      return;
    }
    open = true;
    EFI_STATUS status = BootFileGetSize(&file, &codeSize);
    if (!EFI_ERROR(status) && codeSize != 0) {
      status = BootFileFindSlice(&file, &codeSize, nullptr);
    }
    if (EFI_ERROR(status)) {
      BootFileClose(&file);
      return;
    }
  }
  // A block too large for the header's words is refused like pages that
  // cannot be had.
  const UINT64 total = sizeof(DriverBlockHeader) + record->plistLength + codeSize;
  UINT64 address = gKernelRegionTop;
  UINT64 rounded = total;
  if (codeSize >= kBlockLimit || total >= kBlockLimit || AllocateKernelPages(&address, &rounded) == 0) {
    // The code file's handle goes back with everything else the boot took.
    if (open) {
      BootFileClose(&file);
    }
    Fatal("Could not allocate driver module memory");
  }
  gKernelRegionTop += rounded;

  UINT8 *block = reinterpret_cast<UINT8 *>(address);
  const UINT64 plistAddress = address + sizeof(DriverBlockHeader);
  DriverBlockHeader header = {static_cast<UINT32>(plistAddress), static_cast<UINT32>(record->plistLength),
                              codeSize != 0 ? static_cast<UINT32>(plistAddress + record->plistLength) : 0,
                              static_cast<UINT32>(codeSize)};
  memcpy(block, &header, sizeof(header));
  memcpy(block + sizeof(header), record->plistText, record->plistLength);
  bool staged = true;
  if (codeSize != 0) {
    UINT8 *code = block + sizeof(header) + record->plistLength;
    UINT64 count = codeSize;
    if (EFI_ERROR(BootFileRead(&file, &count, code))) {
      printf("Error reading driver '%S'\n", record->executablePath);
      staged = false;
    } else if (count < codeSize) {
      // A file that ends early: the header keeps the full length, and what
      // did not come reads as zeroes.
      bzero(code + count, codeSize - count);
    }
  }
  if (staged) {
    char name[32];
    sprintf(name, "Driver-%lx", address);
    AddMemoryRange(name, address, total, 1);
  }
  if (open) {
    BootFileClose(&file);
  }
}

void StageDrivers(EFI_FILE *root) {
  CHAR16 *path = static_cast<CHAR16 *>(TrackedAllocatePool(kBundlePathBytes));
  if (path == nullptr) {
    return;
  }
  for (const DriverRecord *record = gDriverRecords; record != nullptr; record = record->next) {
    if (record->state != kDriverNotSelected) {
      StageDriver(root, record, path);
    }
  }
  TrackedFree(path);
}

}  // namespace nimb
