// Directory volumes: a SimpleFileSystem over a host directory, read-only,
// with names matched regardless of case as on a FAT volume.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <filesystem>

#include "hostfw/internal.h"

namespace hostfw {

namespace fs = std::filesystem;

FileObject::~FileObject() {
  if (fd >= 0)
    close(fd);
}

namespace {

constexpr UINT64 kRevision = 0x00010000;
constexpr UINT64 kClusterSize = 4096;
constexpr UINT64 kEndOfFile = ~0ULL;
constexpr EFI_STATUS kWarnDeleteFailure = 2;

std::string HostPath(const Volume &volume, const std::vector<std::string> &components) {
  std::string path = volume.root;
  for (const std::string &component : components)
    path += "/" + component;
  return path;
}

std::string CanonicalPath(const std::string &path) {
  std::error_code error;
  fs::path canonical = fs::weakly_canonical(path, error);
  return error ? path : canonical.string();
}

bool IsDirectory(const std::string &path) {
  struct stat info;
  return stat(path.c_str(), &info) == 0 && S_ISDIR(info.st_mode);
}

std::string AsciiLower(std::string text) {
  for (char &c : text) {
    if (c >= 'A' && c <= 'Z')
      c = char(c - 'A' + 'a');
  }
  return text;
}

// What a FAT volume would show of a host directory: its files and
// subdirectories, in name order.
std::vector<std::string> ListDirectory(const std::string &path) {
  std::vector<std::string> names;
  std::error_code error;
  for (const fs::directory_entry &entry : fs::directory_iterator(path, error)) {
    std::error_code statusError;
    fs::file_status status = entry.status(statusError);
    if (fs::is_regular_file(status) || fs::is_directory(status))
      names.push_back(entry.path().filename().string());
  }
  std::sort(names.begin(), names.end());
  return names;
}

// The entry of `directory` that `name` stands for: the same name, else one
// that differs from it in case only.
bool MatchEntry(const std::string &directory, const std::string &name, std::string *found) {
  std::vector<std::string> names = ListDirectory(directory);
  for (const std::string &candidate : names) {
    if (candidate == name) {
      *found = candidate;
      return true;
    }
  }
  for (const std::string &candidate : names) {
    if (AsciiLower(candidate) == AsciiLower(name)) {
      *found = candidate;
      return true;
    }
  }
  return false;
}

// The host components of `name`, opened from `from`: `\` separates, a
// leading `\` starts at the volume's root, "." and empty parts stay, ".."
// goes up, and a trailing `\` asks for a directory.
EFI_STATUS Resolve(const FileObject &from, const std::u16string &name, std::vector<std::string> *components) {
  std::vector<std::string> path;
  size_t start = 0;
  if (!name.empty() && name[0] == u'\\') {
    start = 1;
  } else {
    if (!from.directory)
      return EFI_NOT_FOUND;
    path = from.components;
  }
  while (start <= name.size()) {
    size_t end = name.find(u'\\', start);
    if (end == std::u16string::npos)
      end = name.size();
    std::string component = Utf16ToUtf8(name.substr(start, end - start));
    start = end + 1;
    if (component.empty() || component == ".")
      continue;
    if (component == "..") {
      if (path.empty())
        return EFI_INVALID_PARAMETER;
      path.pop_back();
      continue;
    }
    std::string directory = HostPath(*from.volume, path);
    std::string found;
    if (!IsDirectory(directory) || !MatchEntry(directory, component, &found))
      return EFI_NOT_FOUND;
    path.push_back(found);
  }
  bool wantsDirectory = name.size() > 1 && name.back() == u'\\';
  if (wantsDirectory && !IsDirectory(HostPath(*from.volume, path)))
    return EFI_NOT_FOUND;
  *components = path;
  return EFI_SUCCESS;
}

int64_t ModificationSeconds(const State &s, const std::string &hostPath, int64_t hostSeconds) {
  auto it = s.fileTimes.find(CanonicalPath(hostPath));
  return it != s.fileTimes.end() ? it->second : hostSeconds;
}

// An EFI_FILE_INFO record, with its name behind it.
std::vector<uint8_t> FileInfoBytes(const State &s, const std::string &hostPath, const std::u16string &name) {
  struct stat host = {};
  stat(hostPath.c_str(), &host);
  bool directory = S_ISDIR(host.st_mode);
  EFI_FILE_INFO info = {};
  info.Size = SIZE_OF_EFI_FILE_INFO + (name.size() + 1) * sizeof(CHAR16);
  info.FileSize = directory ? 0 : UINT64(host.st_size);
  info.PhysicalSize = (info.FileSize + kClusterSize - 1) / kClusterSize * kClusterSize;
  info.ModificationTime = EfiTimeFromSeconds(ModificationSeconds(s, hostPath, host.st_mtime));
  info.CreateTime = info.ModificationTime;
  info.LastAccessTime = info.ModificationTime;
  info.Attribute = directory ? EFI_FILE_DIRECTORY : EFI_FILE_ARCHIVE;
  std::vector<uint8_t> bytes(info.Size);
  std::memcpy(bytes.data(), &info, SIZE_OF_EFI_FILE_INFO);
  std::memcpy(bytes.data() + SIZE_OF_EFI_FILE_INFO, name.c_str(), (name.size() + 1) * sizeof(CHAR16));
  return bytes;
}

// A directory's entries as a FAT volume gives them: a subdirectory starts
// with "." and "..", the root has neither.
std::vector<std::string> DirectoryEntries(const FileObject &file) {
  std::vector<std::string> entries = ListDirectory(HostPath(*file.volume, file.components));
  if (!file.components.empty())
    entries.insert(entries.begin(), {".", ".."});
  return entries;
}

FileObject *FindFile(State &s, EFI_FILE_PROTOCOL *handle) {
  for (const auto &file : s.files) {
    if (&file->protocol == handle)
      return file.get();
  }
  return nullptr;
}

Volume *FindVolume(State &s, EFI_SIMPLE_FILE_SYSTEM_PROTOCOL *fileSystem) {
  for (const auto &volume : s.volumes) {
    if (&volume->fileSystem == fileSystem)
      return volume.get();
  }
  return nullptr;
}

void CloseFile(State &s, FileObject *file) {
  s.closedNames.push_back(file->openedName);
  s.files.erase(std::find_if(s.files.begin(), s.files.end(), [&](const auto &f) { return f.get() == file; }));
}

UINT64 HostFileSize(const FileObject &file) {
  struct stat info;
  return fstat(file.fd, &info) == 0 ? UINT64(info.st_size) : 0;
}

// --- EFI_FILE -------------------------------------------------------------------

EFI_STATUS OpenObject(State &s, Volume *volume, const std::vector<std::string> &components,
                      const std::string &openedName, EFI_FILE_PROTOCOL **handle);

EFI_STATUS EFIAPI Open(EFI_FILE_PROTOCOL *This, EFI_FILE_PROTOCOL **NewHandle, const CHAR16 *FileName,
                       UINT64 OpenMode, UINT64) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "Open", &failure))
    return failure;
  FileObject *from = FindFile(s, This);
  if (from == nullptr || NewHandle == nullptr || FileName == nullptr)
    return EFI_INVALID_PARAMETER;
  std::u16string name(FileName);
  s.openedNames.push_back(Utf16ToUtf8(name));
  if (OpenMode != EFI_FILE_MODE_READ) {
    bool write = OpenMode == (EFI_FILE_MODE_READ | EFI_FILE_MODE_WRITE) ||
                 OpenMode == (EFI_FILE_MODE_READ | EFI_FILE_MODE_WRITE | EFI_FILE_MODE_CREATE);
    return write ? EFI_WRITE_PROTECTED : EFI_INVALID_PARAMETER;
  }
  std::vector<std::string> components;
  EFI_STATUS status = Resolve(*from, name, &components);
  if (EFI_ERROR(status))
    return status;
  return OpenObject(s, from->volume, components, Utf16ToUtf8(name), NewHandle);
}

EFI_STATUS EFIAPI Close(EFI_FILE_PROTOCOL *This) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "Close", &failure))
    return failure;
  FileObject *file = FindFile(s, This);
  if (file == nullptr)
    return EFI_INVALID_PARAMETER;
  CloseFile(s, file);
  return EFI_SUCCESS;
}

// The volume is read-only: Delete closes the handle and deletes nothing.
EFI_STATUS EFIAPI Delete(EFI_FILE_PROTOCOL *This) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "Delete", &failure))
    return failure;
  FileObject *file = FindFile(s, This);
  if (file == nullptr)
    return EFI_INVALID_PARAMETER;
  CloseFile(s, file);
  return kWarnDeleteFailure;
}

EFI_STATUS ReadDirectory(State &s, FileObject &directory, UINTN *BufferSize, VOID *Buffer) {
  if (directory.position >= directory.entries.size()) {
    *BufferSize = 0;
    return EFI_SUCCESS;
  }
  const std::string &entry = directory.entries[directory.position];
  std::vector<std::string> components = directory.components;
  if (entry == "..") {
    components.pop_back();
  } else if (entry != ".") {
    components.push_back(entry);
  }
  std::vector<uint8_t> info = FileInfoBytes(s, HostPath(*directory.volume, components), Utf8ToUtf16(entry));
  if (*BufferSize < info.size()) {
    *BufferSize = info.size();
    return EFI_BUFFER_TOO_SMALL;
  }
  if (Buffer == nullptr)
    return EFI_INVALID_PARAMETER;
  std::memcpy(Buffer, info.data(), info.size());
  *BufferSize = info.size();
  directory.position++;
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI Read(EFI_FILE_PROTOCOL *This, UINTN *BufferSize, VOID *Buffer) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "Read", &failure))
    return failure;
  FileObject *file = FindFile(s, This);
  if (file == nullptr || BufferSize == nullptr)
    return EFI_INVALID_PARAMETER;
  if (file->directory)
    return ReadDirectory(s, *file, BufferSize, Buffer);

  UINT64 size = HostFileSize(*file);
  if (file->position > size)
    return EFI_DEVICE_ERROR;
  UINT64 count = std::min<UINT64>(*BufferSize, size - file->position);
  if (count != 0 && Buffer == nullptr)
    return EFI_INVALID_PARAMETER;
  UINT64 done = 0;
  while (done < count) {
    ssize_t got =
        pread(file->fd, static_cast<uint8_t *>(Buffer) + done, count - done, off_t(file->position + done));
    if (got < 0 && errno == EINTR)
      continue;
    if (got < 0)
      return EFI_DEVICE_ERROR;
    if (got == 0)
      break;
    done += UINT64(got);
  }
  file->position += done;
  *BufferSize = done;
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI Write(EFI_FILE_PROTOCOL *This, UINTN *, VOID *) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "Write", &failure))
    return failure;
  FileObject *file = FindFile(s, This);
  if (file == nullptr)
    return EFI_INVALID_PARAMETER;
  return file->directory ? EFI_UNSUPPORTED : EFI_ACCESS_DENIED;
}

EFI_STATUS EFIAPI GetPosition(EFI_FILE_PROTOCOL *This, UINT64 *Position) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "GetPosition", &failure))
    return failure;
  FileObject *file = FindFile(s, This);
  if (file == nullptr || Position == nullptr)
    return EFI_INVALID_PARAMETER;
  if (file->directory)
    return EFI_UNSUPPORTED;
  *Position = file->position;
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI SetPosition(EFI_FILE_PROTOCOL *This, UINT64 Position) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "SetPosition", &failure))
    return failure;
  FileObject *file = FindFile(s, This);
  if (file == nullptr)
    return EFI_INVALID_PARAMETER;
  if (file->directory) {
    // A directory can only be rewound, and then lists afresh.
    if (Position != 0)
      return EFI_UNSUPPORTED;
    file->entries = DirectoryEntries(*file);
    file->position = 0;
    return EFI_SUCCESS;
  }
  file->position = Position == kEndOfFile ? HostFileSize(*file) : Position;
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI GetInfo(EFI_FILE_PROTOCOL *This, const EFI_GUID *InformationType, UINTN *BufferSize,
                          VOID *Buffer) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "GetInfo", &failure))
    return failure;
  FileObject *file = FindFile(s, This);
  if (file == nullptr || InformationType == nullptr || BufferSize == nullptr)
    return EFI_INVALID_PARAMETER;
  if (!SameGuid(*InformationType, gEfiFileInfoGuid))
    return EFI_UNSUPPORTED;
  std::u16string name = file->components.empty() ? u"" : Utf8ToUtf16(file->components.back());
  std::vector<uint8_t> info = FileInfoBytes(s, HostPath(*file->volume, file->components), name);
  if (*BufferSize < info.size()) {
    *BufferSize = info.size();
    return EFI_BUFFER_TOO_SMALL;
  }
  if (Buffer == nullptr)
    return EFI_INVALID_PARAMETER;
  std::memcpy(Buffer, info.data(), info.size());
  *BufferSize = info.size();
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI SetInfo(EFI_FILE_PROTOCOL *This, const EFI_GUID *, UINTN, VOID *) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "SetInfo", &failure))
    return failure;
  return FindFile(s, This) != nullptr ? EFI_ACCESS_DENIED : EFI_INVALID_PARAMETER;
}

EFI_STATUS EFIAPI Flush(EFI_FILE_PROTOCOL *This) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "Flush", &failure))
    return failure;
  return FindFile(s, This) != nullptr ? EFI_ACCESS_DENIED : EFI_INVALID_PARAMETER;
}

EFI_STATUS OpenObject(State &s, Volume *volume, const std::vector<std::string> &components,
                      const std::string &openedName, EFI_FILE_PROTOCOL **handle) {
  auto file = std::make_unique<FileObject>();
  EFI_FILE_PROTOCOL &p = file->protocol;
  p.Revision = kRevision;
  p.Open = Open;
  p.Close = Close;
  p.Delete = reinterpret_cast<void *>(Delete);
  p.Read = Read;
  p.Write = reinterpret_cast<void *>(Write);
  p.GetPosition = GetPosition;
  p.SetPosition = SetPosition;
  p.GetInfo = GetInfo;
  p.SetInfo = reinterpret_cast<void *>(SetInfo);
  p.Flush = reinterpret_cast<void *>(Flush);
  file->volume = volume;
  file->components = components;
  file->openedName = openedName;

  std::string path = HostPath(*volume, components);
  file->directory = IsDirectory(path);
  if (file->directory) {
    file->entries = DirectoryEntries(*file);
  } else {
    file->fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (file->fd < 0)
      return errno == ENOENT ? EFI_NOT_FOUND : EFI_ACCESS_DENIED;
  }
  *handle = &file->protocol;
  s.files.push_back(std::move(file));
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI OpenVolume(EFI_SIMPLE_FILE_SYSTEM_PROTOCOL *This, EFI_FILE_PROTOCOL **Root) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "OpenVolume", &failure))
    return failure;
  Volume *volume = FindVolume(s, This);
  if (volume == nullptr || Root == nullptr)
    return EFI_INVALID_PARAMETER;
  return OpenObject(s, volume, {}, "\\", Root);
}

}  // namespace

// --- The test's view --------------------------------------------------------------

EFI_HANDLE Firmware::AddDirectoryVolume(const std::string &root, UINT32 partition) {
  State &s = *s_;
  if (!IsDirectory(root))
    Misuse("AddDirectoryVolume: %s is not a directory", root.c_str());
  auto volume = std::make_unique<Volume>();
  volume->fileSystem.Revision = kRevision;
  volume->fileSystem.OpenVolume = OpenVolume;
  volume->root = CanonicalPath(root);

  EFI_HANDLE handle = AddHandle(s);
  unsigned disk = s.nextPciDevice++;
  std::vector<uint8_t> path;
  AppendHardwareNodes(path, disk);
  AppendHardDriveNode(path, partition, 2048, 409600, PartitionSignature(disk, partition));
  AppendEndNode(path);
  InstallDevicePath(s, handle, std::move(path));
  PutInterface(s, handle, gEfiSimpleFileSystemProtocolGuid, &volume->fileSystem);
  s.volumes.push_back(std::move(volume));
  return handle;
}

void Firmware::SetFileTime(const std::string &hostPath, int64_t seconds) {
  s_->fileTimes[CanonicalPath(hostPath)] = seconds;
}

size_t Firmware::OpenFiles() const {
  return s_->files.size();
}
const std::vector<std::string> &Firmware::OpenedNames() const {
  return s_->openedNames;
}
const std::vector<std::string> &Firmware::ClosedNames() const {
  return s_->closedNames;
}

}  // namespace hostfw
