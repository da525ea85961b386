// The handle database: handles, the protocol interfaces on them, the
// services that find them, the loaded image, and device paths.
#include <cstring>

#include "hostfw/internal.h"

namespace hostfw {

namespace {

// The path of this program as the firmware loaded it.
const char16_t kImagePath[] = u"\\EFI\\BOOT\\BOOTX64.EFI";

void AppendNode(std::vector<uint8_t> &path, UINT8 type, UINT8 subType, const std::vector<uint8_t> &payload) {
  size_t length = 4 + payload.size();
  path.insert(path.end(), {type, subType, UINT8(length & 0xFF), UINT8(length >> 8)});
  path.insert(path.end(), payload.begin(), payload.end());
}

template <typename T>
void Put(std::vector<uint8_t> &bytes, T value) {
  const auto *raw = reinterpret_cast<const uint8_t *>(&value);
  bytes.insert(bytes.end(), raw, raw + sizeof(T));
}

// --- Services -------------------------------------------------------------------

EFI_STATUS EFIAPI HandleProtocol(EFI_HANDLE Handle, const EFI_GUID *Protocol, VOID **Interface) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "HandleProtocol", &failure, Protocol))
    return failure;
  if (Protocol == nullptr || Interface == nullptr)
    return EFI_INVALID_PARAMETER;
  *Interface = nullptr;
  if (FindHandle(s, Handle) == nullptr)
    return EFI_INVALID_PARAMETER;
  InterfaceRecord *found = FindProtocol(s, Handle, *Protocol);
  if (found == nullptr)
    return EFI_UNSUPPORTED;
  *Interface = found->interface;
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI LocateProtocol(const EFI_GUID *Protocol, VOID *, VOID **Interface) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "LocateProtocol", &failure, Protocol))
    return failure;
  if (Protocol == nullptr || Interface == nullptr)
    return EFI_INVALID_PARAMETER;
  for (const auto &handle : s.handles) {
    if (InterfaceRecord *found = FindProtocol(s, handle.get(), *Protocol)) {
      *Interface = found->interface;
      return EFI_SUCCESS;
    }
  }
  *Interface = nullptr;
  return EFI_NOT_FOUND;
}

EFI_STATUS EFIAPI LocateHandleBuffer(EFI_LOCATE_SEARCH_TYPE SearchType, const EFI_GUID *Protocol, VOID *,
                                     UINTN *NoHandles, EFI_HANDLE **Buffer) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "LocateHandleBuffer", &failure, Protocol))
    return failure;
  if (NoHandles == nullptr || Buffer == nullptr)
    return EFI_INVALID_PARAMETER;
  if (SearchType == ByRegisterNotify)
    return EFI_UNSUPPORTED;
  if (SearchType != AllHandles && (SearchType != ByProtocol || Protocol == nullptr))
    return EFI_INVALID_PARAMETER;
  std::vector<EFI_HANDLE> found;
  for (const auto &handle : s.handles) {
    if (SearchType == AllHandles || FindProtocol(s, handle.get(), *Protocol) != nullptr)
      found.push_back(handle.get());
  }
  *NoHandles = found.size();
  *Buffer = nullptr;
  if (found.empty())
    return EFI_NOT_FOUND;
  *Buffer = static_cast<EFI_HANDLE *>(
      AllocateLoaderPool(s, found.size() * sizeof(EFI_HANDLE), EfiBootServicesData));
  std::memcpy(*Buffer, found.data(), found.size() * sizeof(EFI_HANDLE));
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI InstallProtocolInterface(EFI_HANDLE *Handle, const EFI_GUID *Protocol,
                                           EFI_INTERFACE_TYPE InterfaceType, VOID *Interface) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "InstallProtocolInterface", &failure, Protocol))
    return failure;
  if (Handle == nullptr || Protocol == nullptr || InterfaceType != EFI_NATIVE_INTERFACE)
    return EFI_INVALID_PARAMETER;
  if (*Handle != nullptr && FindHandle(s, *Handle) == nullptr)
    return EFI_INVALID_PARAMETER;
  if (*Handle != nullptr && FindProtocol(s, *Handle, *Protocol) != nullptr)
    return EFI_INVALID_PARAMETER;
  if (*Handle == nullptr)
    *Handle = AddHandle(s);
  FindHandle(s, *Handle)->interfaces.push_back({*Protocol, Interface});
  return EFI_SUCCESS;
}

// The interface of a handle's protocol swapped for another, in its place.
EFI_STATUS EFIAPI ReinstallProtocolInterface(EFI_HANDLE Handle, const EFI_GUID *Protocol, VOID *OldInterface,
                                             VOID *NewInterface) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "ReinstallProtocolInterface", &failure, Protocol))
    return failure;
  if (Protocol == nullptr || FindHandle(s, Handle) == nullptr)
    return EFI_INVALID_PARAMETER;
  InterfaceRecord *found = FindProtocol(s, Handle, *Protocol);
  if (found == nullptr || found->interface != OldInterface)
    return EFI_NOT_FOUND;
  found->interface = NewInterface;
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI UninstallProtocolInterface(EFI_HANDLE Handle, const EFI_GUID *Protocol, VOID *Interface) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "UninstallProtocolInterface", &failure, Protocol))
    return failure;
  if (Protocol == nullptr)
    return EFI_INVALID_PARAMETER;
  HandleRecord *record = FindHandle(s, Handle);
  if (record == nullptr)
    return EFI_INVALID_PARAMETER;
  for (auto it = record->interfaces.begin(); it != record->interfaces.end(); ++it) {
    if (SameGuid(it->guid, *Protocol) && it->interface == Interface) {
      record->interfaces.erase(it);
      return EFI_SUCCESS;
    }
  }
  return EFI_NOT_FOUND;
}

}  // namespace

// --- Shared with the other parts --------------------------------------------------

bool SameGuid(const EFI_GUID &a, const EFI_GUID &b) {
  return std::memcmp(&a, &b, sizeof(EFI_GUID)) == 0;
}

HandleRecord *FindHandle(State &s, EFI_HANDLE handle) {
  for (const auto &record : s.handles) {
    if (record.get() == handle)
      return record.get();
  }
  return nullptr;
}

InterfaceRecord *FindProtocol(State &s, EFI_HANDLE handle, const EFI_GUID &guid) {
  HandleRecord *record = FindHandle(s, handle);
  if (record == nullptr)
    return nullptr;
  for (InterfaceRecord &entry : record->interfaces) {
    if (SameGuid(entry.guid, guid))
      return &entry;
  }
  return nullptr;
}

void *FindInterface(State &s, EFI_HANDLE handle, const EFI_GUID &guid) {
  InterfaceRecord *found = FindProtocol(s, handle, guid);
  return found != nullptr ? found->interface : nullptr;
}

EFI_HANDLE AddHandle(State &s) {
  s.handles.push_back(std::make_unique<HandleRecord>());
  return s.handles.back().get();
}

void PutInterface(State &s, EFI_HANDLE handle, const EFI_GUID &guid, void *interface) {
  HandleRecord *record = FindHandle(s, handle);
  if (record == nullptr)
    Misuse("InstallProtocol on a handle that this firmware did not make");
  if (InterfaceRecord *found = FindProtocol(s, handle, guid)) {
    found->interface = interface;
  } else {
    record->interfaces.push_back({guid, interface});
  }
}

void InstallDevicePath(State &s, EFI_HANDLE handle, std::vector<uint8_t> bytes) {
  s.devicePaths.push_back(std::make_unique<std::vector<uint8_t>>(std::move(bytes)));
  PutInterface(s, handle, gEfiDevicePathProtocolGuid, s.devicePaths.back()->data());
}

void InstallHandleServices(EFI_BOOT_SERVICES &bs) {
  bs.InstallProtocolInterface = InstallProtocolInterface;
  bs.ReinstallProtocolInterface = reinterpret_cast<void *>(ReinstallProtocolInterface);
  bs.UninstallProtocolInterface = reinterpret_cast<void *>(UninstallProtocolInterface);
  bs.HandleProtocol = HandleProtocol;
  bs.LocateHandleBuffer = LocateHandleBuffer;
  bs.LocateProtocol = LocateProtocol;
}

void InitLoadedImage(State &s) {
  s.imageHandle = AddHandle(s);
  std::vector<uint8_t> filePath;
  AppendFileNode(filePath, kImagePath);
  AppendEndNode(filePath);
  s.devicePaths.push_back(std::make_unique<std::vector<uint8_t>>(std::move(filePath)));

  EFI_LOADED_IMAGE_PROTOCOL &image = s.loadedImage;
  image.Revision = 0x1000;
  image.SystemTable = &s.tables->system;
  image.FilePath = reinterpret_cast<EFI_DEVICE_PATH_PROTOCOL *>(s.devicePaths.back()->data());
  image.ImageCodeType = EfiLoaderCode;
  image.ImageDataType = EfiLoaderData;
  PutInterface(s, s.imageHandle, gEfiLoadedImageProtocolGuid, &image);
}

void AppendHardwareNodes(std::vector<uint8_t> &path, unsigned pciDevice) {
  std::vector<uint8_t> acpi;
  Put<UINT32>(acpi, 0x0A0341D0);  // PNP0A03, the PCI root bridge
  Put<UINT32>(acpi, 0);
  AppendNode(path, ACPI_DEVICE_PATH, 1, acpi);
  AppendNode(path, HARDWARE_DEVICE_PATH, 1, {0, UINT8(pciDevice)});  // function, device
}

void AppendHardDriveNode(std::vector<uint8_t> &path, UINT32 partition, UINT64 start, UINT64 size,
                         const EFI_GUID &signature) {
  std::vector<uint8_t> node;
  Put<UINT32>(node, partition);
  Put<UINT64>(node, start);
  Put<UINT64>(node, size);
  Put<EFI_GUID>(node, signature);
  node.push_back(2);  // a GUID partition table
  node.push_back(2);  // a GUID signature
  AppendNode(path, MEDIA_DEVICE_PATH, MEDIA_HARDDRIVE_DP, node);
}

void AppendFileNode(std::vector<uint8_t> &path, const std::u16string &name) {
  std::vector<uint8_t> node;
  for (char16_t unit : name)
    Put<UINT16>(node, unit);
  Put<UINT16>(node, 0);
  AppendNode(path, MEDIA_DEVICE_PATH, MEDIA_FILEPATH_DP, node);
}

void AppendEndNode(std::vector<uint8_t> &path) {
  AppendNode(path, END_DEVICE_PATH_TYPE, END_ENTIRE_DEVICE_PATH_SUBTYPE, {});
}

EFI_GUID PartitionSignature(unsigned disk, UINT32 partition) {
  return EFI_GUID{0x5EED0000 | (disk << 8) | (partition & 0xFF),
                  0x6E62,
                  0x4000,
                  {0x80, 0x6F, 0x73, 0x74, 0x66, 0x77, UINT8(disk), UINT8(partition)}};
}

// --- The test's view --------------------------------------------------------------

EFI_HANDLE Firmware::NewHandle() {
  return AddHandle(*s_);
}

void Firmware::InstallProtocol(EFI_HANDLE handle, const EFI_GUID &guid, void *interface) {
  PutInterface(*s_, handle, guid, interface);
}

void Firmware::UninstallProtocol(EFI_HANDLE handle, const EFI_GUID &guid) {
  HandleRecord *record = FindHandle(*s_, handle);
  if (record == nullptr)
    Misuse("UninstallProtocol on a handle that this firmware did not make");
  auto &interfaces = record->interfaces;
  for (auto it = interfaces.begin(); it != interfaces.end(); ++it) {
    if (SameGuid(it->guid, guid)) {
      interfaces.erase(it);
      return;
    }
  }
}

void Firmware::SetLoadOptionsBytes(const std::vector<uint8_t> &bytes) {
  // A buffer of exactly this size, so that a read past its end is caught.
  s_->loadOptions = std::vector<uint8_t>(bytes.begin(), bytes.end());
  s_->loadOptions.shrink_to_fit();
  s_->loadedImage.LoadOptionsSize = UINT32(bytes.size());
  s_->loadedImage.LoadOptions = bytes.empty() ? nullptr : s_->loadOptions.data();
}

void Firmware::SetLoadOptions(const std::u16string &text, bool withTerminator) {
  std::vector<uint8_t> bytes;
  for (char16_t unit : text)
    Put<UINT16>(bytes, unit);
  if (withTerminator)
    Put<UINT16>(bytes, 0);
  SetLoadOptionsBytes(bytes);
}

void Firmware::SetBootDevice(EFI_HANDLE device) {
  s_->loadedImage.DeviceHandle = device;
}

EFI_DEVICE_PATH_PROTOCOL *Firmware::DevicePathOf(EFI_HANDLE handle) {
  return static_cast<EFI_DEVICE_PATH_PROTOCOL *>(FindInterface(*s_, handle, gEfiDevicePathProtocolGuid));
}

void Firmware::SetDevicePath(EFI_HANDLE handle, const std::vector<uint8_t> &bytes) {
  InstallDevicePath(*s_, handle, bytes);
}

}  // namespace hostfw
