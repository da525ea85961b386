#include "hostfw/network.h"

#include <cstring>

namespace hostfw {

std::vector<uint8_t> DevicePathNode(uint8_t type, uint8_t subType, const std::vector<uint8_t> &data) {
  size_t length = 4 + data.size();
  std::vector<uint8_t> node = {type, subType, static_cast<uint8_t>(length & 0xFF),
                               static_cast<uint8_t>(length >> 8)};
  node.insert(node.end(), data.begin(), data.end());
  return node;
}

std::vector<uint8_t> FilePathNode(const std::u16string &name) {
  std::vector<uint8_t> data;
  for (char16_t unit : name) {
    data.push_back(static_cast<uint8_t>(unit & 0xFF));
    data.push_back(static_cast<uint8_t>(unit >> 8));
  }
  data.insert(data.end(), {0, 0});
  return DevicePathNode(MEDIA_DEVICE_PATH, MEDIA_FILEPATH_DP, data);
}

std::vector<uint8_t> EndNode() {
  return {END_DEVICE_PATH_TYPE, END_ENTIRE_DEVICE_PATH_SUBTYPE, 4, 0};
}

NetworkDevice::NetworkDevice(Firmware &fw, bool macNode, uint8_t interfaceType) : fw_(fw) {
  protocol_.loadFile.LoadFile = Load;
  protocol_.self = this;
  // PciRoot(0)/Pci(3,0)/MAC(525400123456, type)
  devicePath_ = DevicePathNode(ACPI_DEVICE_PATH, 1, {0xD0, 0x41, 0x03, 0x0A, 0, 0, 0, 0});
  std::vector<uint8_t> pci = DevicePathNode(HARDWARE_DEVICE_PATH, 1, {0, 3});
  devicePath_.insert(devicePath_.end(), pci.begin(), pci.end());
  if (macNode) {
    std::vector<uint8_t> mac(33, 0);
    const uint8_t address[6] = {0x52, 0x54, 0x00, 0x12, 0x34, 0x56};
    memcpy(mac.data(), address, sizeof(address));
    mac[32] = interfaceType;
    std::vector<uint8_t> node = DevicePathNode(MESSAGING_DEVICE_PATH, MSG_MAC_ADDR_DP, mac);
    devicePath_.insert(devicePath_.end(), node.begin(), node.end());
  }
  handle_ = fw_.NewHandle();
  std::vector<uint8_t> whole = devicePath_;
  std::vector<uint8_t> end = EndNode();
  whole.insert(whole.end(), end.begin(), end.end());
  fw_.SetDevicePath(handle_, whole);
  fw_.InstallProtocol(handle_, gEfiLoadFileProtocolGuid, &protocol_.loadFile);
}

void NetworkDevice::PutFile(const std::u16string &name, const std::vector<uint8_t> &bytes) {
  files_[name] = bytes;
}

void NetworkDevice::RemoveFile(const std::u16string &name) {
  files_.erase(name);
}

std::vector<uint8_t> NetworkDevice::FilePath(const std::u16string &name) const {
  std::vector<uint8_t> path = devicePath_;
  std::vector<uint8_t> file = FilePathNode(name);
  std::vector<uint8_t> end = EndNode();
  path.insert(path.end(), file.begin(), file.end());
  path.insert(path.end(), end.begin(), end.end());
  return path;
}

// The name in the first file node of a path, read within the node's length.
static std::u16string FileNodeName(const EFI_DEVICE_PATH_PROTOCOL *path) {
  const uint8_t *node = reinterpret_cast<const uint8_t *>(path);
  for (int guard = 0; node != nullptr && guard < 64; guard++) {
    uint16_t length = static_cast<uint16_t>(node[2] | (node[3] << 8));
    if ((node[0] & 0x7F) == END_DEVICE_PATH_TYPE && node[1] == END_ENTIRE_DEVICE_PATH_SUBTYPE)
      break;
    if (length < 4)
      break;
    if ((node[0] & 0x7F) == MEDIA_DEVICE_PATH && node[1] == MEDIA_FILEPATH_DP) {
      std::u16string name;
      for (size_t i = 4; i + 1 < length; i += 2) {
        char16_t unit = static_cast<char16_t>(node[i] | (node[i + 1] << 8));
        if (unit == 0)
          break;
        name.push_back(unit);
      }
      return name;
    }
    node += length;
  }
  return u"";
}

EFI_STATUS EFIAPI NetworkDevice::Load(EFI_LOAD_FILE_PROTOCOL *This, EFI_DEVICE_PATH_PROTOCOL *FilePath,
                                      BOOLEAN BootPolicy, UINTN *BufferSize, VOID *Buffer) {
  NetworkDevice *self = reinterpret_cast<Interface *>(This)->self;
  LoadFileCall call{u"", Buffer != nullptr, BufferSize != nullptr ? *BufferSize : 0, EFI_SUCCESS};
  auto finish = [&](EFI_STATUS status) {
    call.status = status;
    self->calls_.push_back(call);
    return status;
  };
  if (BufferSize == nullptr || FilePath == nullptr || BootPolicy) {
    return finish(EFI_INVALID_PARAMETER);
  }
  call.name = FileNodeName(FilePath);
  std::u16string key = call.name;
  if (!key.empty() && key[0] == u'\\')
    key.erase(0, 1);
  auto it = self->files_.find(key);
  if (it == self->files_.end()) {
    return finish(EFI_NOT_FOUND);
  }
  const std::vector<uint8_t> &bytes = it->second;
  if (Buffer == nullptr) {
    if (self->sizeQuerySuccess_)
      return finish(EFI_SUCCESS);
    *BufferSize = bytes.size();
    return finish(EFI_BUFFER_TOO_SMALL);
  }
  size_t deliver = bytes.size();
  if (self->skew_ != 0) {
    deliver = static_cast<size_t>(static_cast<long>(deliver) + self->skew_);
    self->skew_ = 0;
  }
  if (*BufferSize < deliver) {
    *BufferSize = deliver;
    return finish(EFI_BUFFER_TOO_SMALL);
  }
  std::vector<uint8_t> data = bytes;
  data.resize(deliver, 0x5A);
  if (deliver != 0)
    memcpy(Buffer, data.data(), deliver);
  *BufferSize = deliver;
  return finish(EFI_SUCCESS);
}

}  // namespace hostfw
