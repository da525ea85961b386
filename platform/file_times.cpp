#include "file_times.h"

#include "firmware.h"
#include "support/strings.h"

namespace nimb::platform {

namespace {

constexpr INT16 kUnspecifiedTimeZone = 0x07FF;
constexpr UINT64 kFileRevision = 0x00010000;

// --- the table ----------------------------------------------------------------------

// `count` decimal digits at `*text` into `*value`, moving on; false unless
// all are digits and the value is at most `limit`.
bool TakeNumber(const char **text, UINT32 count, UINT32 limit, UINT32 *value) {
  *value = 0;
  for (UINT32 i = 0; i < count; i++) {
    const char c = (*text)[i];
    if (c < '0' || c > '9') {
      return false;
    }
    *value = *value * 10 + static_cast<UINT32>(c - '0');
  }
  *text += count;
  return *value <= limit;
}

bool TakeChar(const char **text, char wanted) {
  if (**text != wanted) {
    return false;
  }
  (*text)++;
  return true;
}

// "YYYY-MM-DD hh:mm:ss.n... \path" into `entry`; the path stays in the line.
bool ParseEntry(const char *line, FileTimeEntry *entry) {
  UINT32 year, month, day, hour, minute, second;
  const char *at = line;
  if (!TakeNumber(&at, 4, 9999, &year) || !TakeChar(&at, '-') || !TakeNumber(&at, 2, 12, &month) ||
      !TakeChar(&at, '-') || !TakeNumber(&at, 2, 31, &day) || !TakeChar(&at, ' ') ||
      !TakeNumber(&at, 2, 23, &hour) || !TakeChar(&at, ':') || !TakeNumber(&at, 2, 59, &minute) ||
      !TakeChar(&at, ':') || !TakeNumber(&at, 2, 59, &second) || month == 0 || day == 0) {
    return false;
  }
  UINT32 nanosecond = 0;
  if (TakeChar(&at, '.')) {
    UINT32 digits = 0;
    for (; at[digits] >= '0' && at[digits] <= '9'; digits++) {
    }
    UINT32 fraction = 0;
    if (digits == 0 || digits > 9 || !TakeNumber(&at, digits, 999999999, &fraction)) {
      return false;
    }
    nanosecond = fraction;
    for (; digits < 9; digits++) {
      nanosecond *= 10;
    }
  }
  if (!TakeChar(&at, ' ') || !TakeChar(&at, '\\') || *at == '\0') {
    return false;
  }
  *entry = FileTimeEntry{at, {}};
  entry->time.Year = static_cast<UINT16>(year);
  entry->time.Month = static_cast<UINT8>(month);
  entry->time.Day = static_cast<UINT8>(day);
  entry->time.Hour = static_cast<UINT8>(hour);
  entry->time.Minute = static_cast<UINT8>(minute);
  entry->time.Second = static_cast<UINT8>(second);
  entry->time.Nanosecond = nanosecond;
  entry->time.TimeZone = kUnspecifiedTimeZone;
  return true;
}

char FoldCase(UINT32 c) {
  return static_cast<char>(c >= 'A' && c <= 'Z' ? c - 'A' + 'a' : c);
}

// Whether the UTF-8 `text` is the UCS-2 `wide`, ASCII letters in either case.
bool PathEquals(const char *text, const CHAR16 *wide) {
  const UINT8 *byte = reinterpret_cast<const UINT8 *>(text);
  for (;; wide++) {
    UINT32 unit = *byte++;
    if (unit >= 0xE0) {
      unit = (unit & 0x0F) << 12 | (byte[0] & 0x3F) << 6 | (byte[1] & 0x3F);
      byte += byte[0] != 0 && byte[1] != 0 ? 2 : 0;
    } else if (unit >= 0xC0) {
      unit = (unit & 0x1F) << 6 | (byte[0] & 0x3F);
      byte += byte[0] != 0 ? 1 : 0;
    }
    if (unit < 0x80 ? FoldCase(unit) != FoldCase(*wide) : unit != *wide) {
      return false;
    }
    if (unit == 0) {
      return true;
    }
  }
}

// --- the wrapper -----------------------------------------------------------------------

typedef EFI_STATUS(EFIAPI *FileSimpleCall)(EFI_FILE_PROTOCOL *This);
typedef EFI_STATUS(EFIAPI *FileWriteCall)(EFI_FILE_PROTOCOL *This, UINTN *BufferSize, VOID *Buffer);
typedef EFI_STATUS(EFIAPI *FileSetInfoCall)(EFI_FILE_PROTOCOL *This, const EFI_GUID *InformationType,
                                            UINTN BufferSize, VOID *Buffer);
typedef EFI_STATUS(EFIAPI *ReinstallCall)(EFI_HANDLE Handle, const EFI_GUID *Protocol, VOID *OldInterface,
                                          VOID *NewInterface);

enum Kind : UINT8 { kKindUnknown, kKindFile, kKindDirectory };

// One open file of the loader: the interface it holds comes first, so that
// its handle is the record.
struct TimedFile {
  EFI_FILE_PROTOCOL file;
  EFI_FILE_PROTOCOL *inner;
  bool used;
  bool pathKnown;
  Kind kind;
  CHAR16 path[kMaxTimedPath];
};

struct TimedVolume {
  EFI_SIMPLE_FILE_SYSTEM_PROTOCOL volume;
  EFI_SIMPLE_FILE_SYSTEM_PROTOCOL *inner;
  const FileTimeTable *table;
};

// A fixed stock of records: the wrapper takes no memory from the firmware
// while the loader runs, so its memory measurement stays as it would be.
constexpr UINT32 kMaxOpenFiles = 64;
TimedFile gFiles[kMaxOpenFiles];
TimedVolume gVolume;
UINT64 gServed;

TimedFile *Timed(EFI_FILE_PROTOCOL *file) {
  return reinterpret_cast<TimedFile *>(file);
}

void ServeTime(const CHAR16 *path, EFI_FILE_INFO *info) {
  const EFI_TIME *time = FileTimesFind(*gVolume.table, path);
  if (time != nullptr) {
    info->ModificationTime = *time;
    gServed++;
  }
}

EFI_STATUS EFIAPI TimedOpen(EFI_FILE_PROTOCOL *This, EFI_FILE_PROTOCOL **NewHandle, const CHAR16 *FileName,
                            UINT64 OpenMode, UINT64 Attributes);

EFI_STATUS EFIAPI TimedClose(EFI_FILE_PROTOCOL *This) {
  TimedFile *file = Timed(This);
  const EFI_STATUS status = file->inner->Close(file->inner);
  file->used = false;
  return status;
}

EFI_STATUS EFIAPI TimedDelete(EFI_FILE_PROTOCOL *This) {
  TimedFile *file = Timed(This);
  const EFI_STATUS status = reinterpret_cast<FileSimpleCall>(file->inner->Delete)(file->inner);
  file->used = false;
  return status;
}

EFI_STATUS EFIAPI TimedGetInfo(EFI_FILE_PROTOCOL *This, const EFI_GUID *InformationType, UINTN *BufferSize,
                               VOID *Buffer) {
  TimedFile *file = Timed(This);
  const EFI_STATUS status = file->inner->GetInfo(file->inner, InformationType, BufferSize, Buffer);
  if (!EFI_ERROR(status) && file->pathKnown && CompareGuid(InformationType, &gEfiFileInfoGuid)) {
    ServeTime(file->path, static_cast<EFI_FILE_INFO *>(Buffer));
  }
  return status;
}

// A directory's entries are EFI_FILE_INFO records too, and get their times.
EFI_STATUS EFIAPI TimedRead(EFI_FILE_PROTOCOL *This, UINTN *BufferSize, VOID *Buffer) {
  TimedFile *file = Timed(This);
  if (file->kind == kKindUnknown) {
    UINT64 info[(SIZE_OF_EFI_FILE_INFO + kMaxTimedPath * sizeof(CHAR16)) / sizeof(UINT64) + 1];
    UINTN size = sizeof(info);
    if (!EFI_ERROR(file->inner->GetInfo(file->inner, &gEfiFileInfoGuid, &size, info))) {
      const UINT64 attributes = reinterpret_cast<EFI_FILE_INFO *>(info)->Attribute;
      file->kind = (attributes & EFI_FILE_DIRECTORY) != 0 ? kKindDirectory : kKindFile;
    }
  }
  const EFI_STATUS status = file->inner->Read(file->inner, BufferSize, Buffer);
  if (!EFI_ERROR(status) && file->kind == kKindDirectory && file->pathKnown &&
      *BufferSize >= SIZE_OF_EFI_FILE_INFO) {
    EFI_FILE_INFO *entry = static_cast<EFI_FILE_INFO *>(Buffer);
    CHAR16 path[kMaxTimedPath];
    if (FileTimesJoin(file->path, entry->FileName, path)) {
      ServeTime(path, entry);
    }
  }
  return status;
}

EFI_STATUS EFIAPI TimedWrite(EFI_FILE_PROTOCOL *This, UINTN *BufferSize, VOID *Buffer) {
  TimedFile *file = Timed(This);
  return reinterpret_cast<FileWriteCall>(file->inner->Write)(file->inner, BufferSize, Buffer);
}

EFI_STATUS EFIAPI TimedGetPosition(EFI_FILE_PROTOCOL *This, UINT64 *Position) {
  TimedFile *file = Timed(This);
  return file->inner->GetPosition(file->inner, Position);
}

EFI_STATUS EFIAPI TimedSetPosition(EFI_FILE_PROTOCOL *This, UINT64 Position) {
  TimedFile *file = Timed(This);
  return file->inner->SetPosition(file->inner, Position);
}

EFI_STATUS EFIAPI TimedSetInfo(EFI_FILE_PROTOCOL *This, const EFI_GUID *InformationType, UINTN BufferSize,
                               VOID *Buffer) {
  TimedFile *file = Timed(This);
  return reinterpret_cast<FileSetInfoCall>(file->inner->SetInfo)(file->inner, InformationType, BufferSize,
                                                                 Buffer);
}

EFI_STATUS EFIAPI TimedFlush(EFI_FILE_PROTOCOL *This) {
  TimedFile *file = Timed(This);
  return reinterpret_cast<FileSimpleCall>(file->inner->Flush)(file->inner);
}

// Wraps the firmware's `inner` handle; on a full stock the handle is closed
// and the open refused.
EFI_STATUS Wrap(EFI_FILE_PROTOCOL *inner, const CHAR16 *base, const CHAR16 *name,
                EFI_FILE_PROTOCOL **handle) {
  for (TimedFile &file : gFiles) {
    if (file.used) {
      continue;
    }
    file.used = true;
    file.inner = inner;
    file.kind = kKindUnknown;
    file.pathKnown = FileTimesJoin(base, name, file.path);
    file.file = EFI_FILE_PROTOCOL{kFileRevision,
                                  TimedOpen,
                                  TimedClose,
                                  reinterpret_cast<void *>(TimedDelete),
                                  TimedRead,
                                  reinterpret_cast<void *>(TimedWrite),
                                  TimedGetPosition,
                                  TimedSetPosition,
                                  TimedGetInfo,
                                  reinterpret_cast<void *>(TimedSetInfo),
                                  reinterpret_cast<void *>(TimedFlush)};
    *handle = &file.file;
    return EFI_SUCCESS;
  }
  inner->Close(inner);
  return EFI_OUT_OF_RESOURCES;
}

EFI_STATUS EFIAPI TimedOpen(EFI_FILE_PROTOCOL *This, EFI_FILE_PROTOCOL **NewHandle, const CHAR16 *FileName,
                            UINT64 OpenMode, UINT64 Attributes) {
  TimedFile *file = Timed(This);
  EFI_FILE_PROTOCOL *inner = nullptr;
  const EFI_STATUS status = file->inner->Open(file->inner, &inner, FileName, OpenMode, Attributes);
  if (EFI_ERROR(status)) {
    return status;
  }
  return Wrap(inner, file->pathKnown ? file->path : nullptr, FileName, NewHandle);
}

EFI_STATUS EFIAPI TimedOpenVolume(EFI_SIMPLE_FILE_SYSTEM_PROTOCOL *This, EFI_FILE_PROTOCOL **Root) {
  TimedVolume *volume = reinterpret_cast<TimedVolume *>(This);
  EFI_FILE_PROTOCOL *inner = nullptr;
  const EFI_STATUS status = volume->inner->OpenVolume(volume->inner, &inner);
  if (EFI_ERROR(status)) {
    return status;
  }
  return Wrap(inner, u"", u"", Root);
}

}  // namespace

UINT32 FileTimesCapacity(const char *text, UINTN size) {
  UINT32 lines = 1;
  for (UINTN i = 0; i < size; i++) {
    lines += text[i] == '\n';
  }
  return lines;
}

UINT32 FileTimesParse(char *text, UINTN size, FileTimeTable *table) {
  text[size] = '\0';
  UINT32 number = 0;
  for (char *line = text; line < text + size;) {
    number++;
    char *end = line;
    while (*end != '\0' && *end != '\n') {
      end++;
    }
    char *next = *end == '\0' ? end : end + 1;
    if (end > line && end[-1] == '\r') {
      end--;
    }
    *end = '\0';
    if (*line != '\0' && *line != '#') {
      if (table->count == table->capacity || !ParseEntry(line, &table->entries[table->count])) {
        return number;
      }
      table->count++;
    }
    line = next;
  }
  return 0;
}

const EFI_TIME *FileTimesFind(const FileTimeTable &table, const CHAR16 *path) {
  for (UINT32 i = 0; i < table.count; i++) {
    if (PathEquals(table.entries[i].path, path)) {
      return &table.entries[i].time;
    }
  }
  return nullptr;
}

bool FileTimesJoin(const CHAR16 *base, const CHAR16 *name, CHAR16 *out) {
  UINTN length = 0;
  if (*name != u'\\') {
    if (base == nullptr) {
      return false;
    }
    for (; base[length] != 0; length++) {
      if (length + 1 >= kMaxTimedPath) {
        return false;
      }
      out[length] = base[length];
    }
  }
  const CHAR16 *part = name;
  while (*part != 0) {
    while (*part == u'\\') {
      part++;
    }
    UINTN size = 0;
    while (part[size] != 0 && part[size] != u'\\') {
      size++;
    }
    if (size == 1 && part[0] == u'.') {
      // stays
    } else if (size == 2 && part[0] == u'.' && part[1] == u'.') {
      while (length > 0 && out[length - 1] != u'\\') {
        length--;
      }
      length -= length > 0;
    } else if (size != 0) {
      if (length + (length != 0) + size + 1 > kMaxTimedPath) {
        return false;
      }
      if (length != 0) {
        out[length++] = u'\\';
      }
      for (UINTN i = 0; i < size; i++) {
        out[length++] = part[i];
      }
    }
    part += size;
  }
  out[length] = 0;
  return true;
}

EFI_STATUS FileTimesInstall(EFI_HANDLE device, const FileTimeTable *table) {
  void *interface = nullptr;
  EFI_STATUS status = gBS->HandleProtocol(device, &gEfiSimpleFileSystemProtocolGuid, &interface);
  if (EFI_ERROR(status)) {
    return status;
  }
  gVolume.inner = static_cast<EFI_SIMPLE_FILE_SYSTEM_PROTOCOL *>(interface);
  gVolume.volume = EFI_SIMPLE_FILE_SYSTEM_PROTOCOL{gVolume.inner->Revision, TimedOpenVolume};
  gVolume.table = table;
  return reinterpret_cast<ReinstallCall>(gBS->ReinstallProtocolInterface)(
      device, &gEfiSimpleFileSystemProtocolGuid, interface, &gVolume.volume);
}

void FileTimesUninstall(EFI_HANDLE device) {
  if (gVolume.inner != nullptr) {
    reinterpret_cast<ReinstallCall>(gBS->ReinstallProtocolInterface)(
        device, &gEfiSimpleFileSystemProtocolGuid, &gVolume.volume, gVolume.inner);
    gVolume.inner = nullptr;
  }
}

UINT64 FileTimesServed() {
  return gServed;
}

}  // namespace nimb::platform
