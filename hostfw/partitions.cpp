// Device paths of partitions: hard-drive nodes of either partitioning
// scheme behind a disk's hardware nodes.
#include <cstring>

#include "hostfw/internal.h"

namespace hostfw {

namespace {

constexpr size_t kHardDriveNodeSize = 42;

template <typename T>
void Put(std::vector<uint8_t> &bytes, T value) {
  const auto *raw = reinterpret_cast<const uint8_t *>(&value);
  bytes.insert(bytes.end(), raw, raw + sizeof(T));
}

// The node as given; a length other than 42 cuts the node or pads it with zeros.
void AppendNode(std::vector<uint8_t> &path, const HardDriveNode &node) {
  std::vector<uint8_t> bytes = {MEDIA_DEVICE_PATH, MEDIA_HARDDRIVE_DP};
  Put<UINT16>(bytes, node.length);
  Put<UINT32>(bytes, node.partition);
  Put<UINT64>(bytes, node.start);
  Put<UINT64>(bytes, node.blocks);
  bytes.insert(bytes.end(), node.signature, node.signature + sizeof(node.signature));
  bytes.push_back(node.format);
  bytes.push_back(node.signatureType);
  if (bytes.size() != kHardDriveNodeSize)
    Misuse("the hard-drive node is laid out wrong");
  bytes.resize(node.length < 4 ? 4 : node.length, 0);
  path.insert(path.end(), bytes.begin(), bytes.end());
}

}  // namespace

HardDriveNode HardDriveNode::Gpt(const EFI_GUID &guid, UINT32 partition) {
  HardDriveNode node;
  node.partition = partition;
  std::memcpy(node.signature, &guid, sizeof(guid));
  node.format = 2;
  node.signatureType = 2;
  return node;
}

HardDriveNode HardDriveNode::Mbr(UINT32 diskSignature, UINT32 partition) {
  HardDriveNode node;
  node.partition = partition;
  std::memcpy(node.signature, &diskSignature, sizeof(diskSignature));
  node.format = 1;
  node.signatureType = 1;
  return node;
}

void Firmware::SetHardDrivePath(EFI_HANDLE handle, const std::vector<HardDriveNode> &nodes) {
  State &s = *s_;
  if (FindHandle(s, handle) == nullptr)
    Misuse("SetHardDrivePath on a handle that this firmware did not make");
  // The handle's own nodes up to its first hard-drive node or its end.
  std::vector<uint8_t> path;
  if (const auto *old = static_cast<const uint8_t *>(FindInterface(s, handle, gEfiDevicePathProtocolGuid))) {
    for (;;) {
      const UINT8 type = old[0] & 0x7F;
      const UINT8 subType = old[1];
      const size_t length = size_t(old[2]) | size_t(old[3]) << 8;
      if (type == END_DEVICE_PATH_TYPE || (type == MEDIA_DEVICE_PATH && subType == MEDIA_HARDDRIVE_DP) ||
          length < 4) {
        break;
      }
      path.insert(path.end(), old, old + length);
      old += length;
    }
  }
  for (const HardDriveNode &node : nodes)
    AppendNode(path, node);
  AppendEndNode(path);
  InstallDevicePath(s, handle, std::move(path));
}

}  // namespace hostfw
