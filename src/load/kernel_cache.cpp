#include "load/kernel_cache.h"

#include "boot/boot.h"
#include "config/boot_options.h"
#include "config/options.h"
#include "devicetree/platform.h"
#include "load/bootfile.h"
#include "load/kernel.h"
#include "load/lzss.h"
#include "memory/tracking.h"
#include "screen/console.h"
#include "support/checksum.h"
#include "support/devicepath.h"
#include "support/sprint.h"
#include "support/strings.h"
#include "support/text.h"

namespace nimb {

UINT8 gKernelCacheKey[kCacheKeyBytes];
CHAR16 gKernelCachePath[512];

void MakeKernelCacheKey() {
  bzero(gKernelCacheKey, sizeof(gKernelCacheKey));
  // The model name may fill its 64 bytes without a terminator.
  const char *model = GetModelName();
  for (UINTN i = 0; i < kCacheModelBytes && model[i] != '\0'; i++) {
    gKernelCacheKey[i] = static_cast<UINT8>(model[i]);
  }
  UINT8 *path = gKernelCacheKey + kCacheModelBytes;
  UINTN pathBytes = DevicePathSize(gBootDevicePath);
  if (pathBytes > kCacheBootPathBytes) {
    pathBytes = kCacheBootPathBytes;
  }
  memcpy(path, gBootDevicePath, pathBytes);
  // The kernel's name with its terminator in what the path leaves; a name
  // that does not fit is cut between characters.
  if (pathBytes < kCacheBootPathBytes && gKernelName != nullptr) {
    UcsToUtf8(reinterpret_cast<const UINT16 *>(gKernelName), static_cast<INT32>(StrLen(gKernelName)),
              path + pathBytes, static_cast<UINT32>(kCacheBootPathBytes - pathBytes), 0);
  }
}

void PickNewerFileInfo(const EFI_FILE_INFO *a, const EFI_FILE_INFO *b, EFI_FILE_INFO *out) {
  const EFI_TIME &ta = a->ModificationTime;
  const EFI_TIME &tb = b->ModificationTime;
  const UINT32 fieldsA[] = {ta.Year, ta.Month, ta.Day, ta.Hour, ta.Minute, ta.Second};
  const UINT32 fieldsB[] = {tb.Year, tb.Month, tb.Day, tb.Hour, tb.Minute, tb.Second};
  const EFI_FILE_INFO *newer = a;
  for (UINTN i = 0; i < sizeof(fieldsA) / sizeof(fieldsA[0]); i++) {
    if (fieldsA[i] != fieldsB[i]) {
      newer = fieldsB[i] > fieldsA[i] ? b : a;
      break;
    }
  }
  if (newer != out) {
    memcpy(out, newer, sizeof(EFI_FILE_INFO));
  }
}

static bool IsLeapYear(UINT32 year) {
  return (year % 4 == 0 && year % 100 != 0) || year % 400 == 0;
}

static UINT32 DaysInMonth(UINT32 month, UINT32 year) {
  switch (month) {
    case 1:
    case 3:
    case 5:
    case 7:
    case 8:
    case 10:
    case 12:
      return 31;
    case 2:
      return IsLeapYear(year) ? 29 : 28;
    default:
      return 30;
  }
}

BOOLEAN IsOneSecondAfter(const EFI_FILE_INFO *earlier, const EFI_FILE_INFO *later) {
  EFI_TIME time;
  memcpy(&time, &earlier->ModificationTime, sizeof(time));
  // One second on, with the calendar's carries; each step ends the carry
  // unless its field overflowed.
  if (++time.Second >= 60) {
    time.Second = 0;
    if (++time.Minute >= 60) {
      time.Minute = 0;
      if (++time.Hour >= 24) {
        time.Hour = 0;
        time.Day++;
        if (time.Day > DaysInMonth(time.Month, time.Year)) {
          time.Day = 1;
          time.Month++;
        }
        if (time.Month > 12) {
          time.Month = 1;
          time.Year++;
        }
      }
    }
  }
  return memcmp(&time, &later->ModificationTime, sizeof(time)) == 0;
}

// What a try at the cache holds; all of it goes when the try ends.
struct CacheTry {
  EFI_FILE_INFO *cacheInfo;
  EFI_FILE_INFO *kernelInfo;
  EFI_FILE_INFO *extensionsInfo;
  BootFile file;
  bool fileOpen;
  UINT8 *compressed;
  UINT8 *uncompressed;
};

// The info record of `name` under `root`, which is opened and closed for it.
static EFI_STATUS GetNamedFileInfo(EFI_FILE *root, const CHAR16 *name, EFI_FILE_INFO **info) {
  EFI_FILE *handle = nullptr;
  EFI_STATUS status = root->Open(root, &handle, name, EFI_FILE_MODE_READ, 0);
  if (EFI_ERROR(status)) {
    return status;
  }
  status = BootFileGetInfo(handle, info);
  handle->Close(handle);
  return status;
}

static bool IsDirectory(const EFI_FILE_INFO *info) {
  return (info->Attribute & EFI_FILE_DIRECTORY) != 0;
}

static UINT32 BigEndian32(const UINT8 bytes[4]) {
  return static_cast<UINT32>(bytes[0]) << 24 | static_cast<UINT32>(bytes[1]) << 16 |
         static_cast<UINT32>(bytes[2]) << 8 | bytes[3];
}

// A field of the header that starts with a zero byte is not compared.
static bool FieldMatches(const UINT8 *field, const UINT8 *key, UINTN size) {
  return field[0] == 0 || memcmp(field, key, size) == 0;
}

// Whole pages for `size` bytes, at least one, so that an empty stream still
// has a place. Pages, not pool: the firmware takes and gives back a block of
// many mebibytes of pages much faster.
static UINT8 *AllocateData(UINT32 size) {
  EFI_PHYSICAL_ADDRESS address = 0;
  const UINTN pages = size != 0 ? static_cast<UINTN>(EFI_SIZE_TO_PAGES(size)) : 1;
  if (EFI_ERROR(TrackedAllocatePages(AllocateAnyPages, EfiBootServicesData, pages, &address))) {
    return nullptr;
  }
  return reinterpret_cast<UINT8 *>(address);
}

static EFI_STATUS TryKernelCache(EFI_FILE *root, CacheTry *t) {
  // The three records before any byte of the cache is read.
  EFI_STATUS status = GetNamedFileInfo(root, gKernelCachePath, &t->cacheInfo);
  if (EFI_ERROR(status)) {
    return status;
  }
  if (IsDirectory(t->cacheInfo)) {
    return EFI_NOT_FOUND;
  }
  status = GetNamedFileInfo(root, gKernelName, &t->kernelInfo);
  if (EFI_ERROR(status)) {
    return status;
  }
  if (IsDirectory(t->kernelInfo)) {
    return EFI_NOT_FOUND;
  }
  status = GetNamedFileInfo(root, kExtensionsPath, &t->extensionsInfo);
  if (EFI_ERROR(status)) {
    return status;
  }
  if (!IsDirectory(t->extensionsInfo)) {
    return EFI_NOT_FOUND;
  }
  PickNewerFileInfo(t->kernelInfo, t->extensionsInfo, t->kernelInfo);
  if (!IsOneSecondAfter(t->kernelInfo, t->cacheInfo)) {
    return EFI_NOT_FOUND;
  }

  status = BootFileOpen(nullptr, root, gKernelCachePath, &t->file);
  if (EFI_ERROR(status)) {
    return status;
  }
  t->fileOpen = true;
  CacheHeader header;
  UINT64 count = sizeof(header);
  status = BootFileRead(&t->file, &count, &header);
  if (EFI_ERROR(status)) {
    return status;
  }
  if (count != sizeof(header)) {
    return EFI_NOT_FOUND;
  }
  if (BigEndian32(header.signature) != kCacheSignature) {
    // An uncompressed kernel, fat or not, as it stands.
    BootFileSetPosition(&t->file, 0);
    return LoadKernel(&t->file);
  }
  if (BigEndian32(header.compressType) != kCacheCompressLzss) {
    return EFI_NOT_FOUND;
  }
  if (!FieldMatches(header.modelName, gKernelCacheKey, kCacheModelBytes) ||
      !FieldMatches(header.bootPath, gKernelCacheKey + kCacheModelBytes, kCacheBootPathBytes)) {
    return EFI_NOT_FOUND;
  }

  const UINT32 compressedSize = BigEndian32(header.compressedSize);
  t->compressed = AllocateData(compressedSize);
  if (t->compressed == nullptr) {
    return EFI_OUT_OF_RESOURCES;
  }
  count = compressedSize;
  status = BootFileRead(&t->file, &count, t->compressed);
  if (EFI_ERROR(status)) {
    return status;
  }
  if (count != compressedSize) {
    return EFI_NOT_FOUND;
  }
  const UINT32 uncompressedSize = BigEndian32(header.uncompressedSize);
  t->uncompressed = AllocateData(uncompressedSize);
  if (t->uncompressed == nullptr) {
    return EFI_OUT_OF_RESOURCES;
  }
  // The stream may not write past the size the header gives: a corrupt one
  // stops there and comes out short or checks wrong.
  if (DecompressLzss(t->uncompressed, uncompressedSize, t->compressed, compressedSize) != uncompressedSize) {
    return EFI_DEVICE_ERROR;
  }
  UINT32 checksum = Adler32(t->uncompressed, uncompressedSize);
  if (memcmp(&checksum, header.adler32, sizeof(checksum)) != 0) {
    return EFI_DEVICE_ERROR;
  }

  BootFileClose(&t->file);
  t->fileOpen = false;
  TrackedFree(t->compressed);
  t->compressed = nullptr;
  BootFile memory;
  bzero(&memory, sizeof(memory));
  memory.buffer = t->uncompressed;
  memory.size = uncompressedSize;
  return LoadKernel(&memory);
}

EFI_STATUS LoadKernelCache(EFI_LOAD_FILE_INTERFACE *, EFI_FILE *root) {
  if ((gBootFlags & (kBootSafeMode | kBootNetwork | kBootOtherKernel)) != 0 || gCustomDriverPackage) {
    return EFI_ACCESS_DENIED;
  }
  // Boot options that could not be settled leave no kernel name to check.
  if (root == nullptr || gKernelName == nullptr) {
    return EFI_NOT_FOUND;
  }
  MakeKernelCacheKey();
  const UINT64 checksum = Adler32(gKernelCacheKey, sizeof(gKernelCacheKey));
  const char *name = GetConfigValue("Kernel Cache");
  if (name != nullptr) {
    SPrint(gKernelCachePath, sizeof(gKernelCachePath), u"%a.%08x", name, checksum);
  } else {
    SPrint(gKernelCachePath, sizeof(gKernelCachePath), u"%S.%08x", NIMB_KERNEL_CACHE_DEFAULT, checksum);
  }
  printf("Looking for kernel cache file '%S'\n", gKernelCachePath);

  CacheTry t;
  bzero(&t, sizeof(t));
  EFI_STATUS status = TryKernelCache(root, &t);
  if (t.fileOpen) {
    BootFileClose(&t.file);
  }
  void *held[] = {t.cacheInfo, t.kernelInfo, t.extensionsInfo, t.compressed, t.uncompressed};
  for (void *block : held) {
    if (block != nullptr) {
      TrackedFree(block);
    }
  }
  return status;
}

}  // namespace nimb
