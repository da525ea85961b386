// A network boot device for the host firmware: a handle with a device path
// over a network card (with a MAC address node, unless asked otherwise) and
// a LoadFile protocol that serves files by the name in a file path node, as
// a boot server would.
#pragma once

#include <map>
#include <string>
#include <vector>

#include "hostfw/hostfw.h"

namespace hostfw {

struct LoadFileCall {
  std::u16string name;  // the file node's name; empty for a path without one
  bool withBuffer;      // a fetch (true) or a size query (false)
  UINTN bufferSize;     // the size the caller offered
  EFI_STATUS status;
};

class NetworkDevice {
 public:
  NetworkDevice(Firmware &fw, bool macNode = true, uint8_t interfaceType = 1);
  NetworkDevice(const NetworkDevice &) = delete;
  NetworkDevice &operator=(const NetworkDevice &) = delete;

  EFI_HANDLE Handle() const { return handle_; }
  EFI_LOAD_FILE_PROTOCOL *Protocol() { return &protocol_.loadFile; }

  // Serves `bytes` for `name` (matched exactly; a leading `\` is ignored).
  void PutFile(const std::u16string &name, const std::vector<uint8_t> &bytes);
  void RemoveFile(const std::u16string &name);
  const std::vector<LoadFileCall> &Calls() const { return calls_; }
  // The next fetch delivers `delta` bytes more (or fewer) than the file has,
  // as a file that changed between the size query and the fetch.
  void SkewNextFetch(int delta) { skew_ = delta; }
  // Size queries succeed without telling a size, as some firmware does.
  void AnswerSizeQueryWithSuccess(bool on) { sizeQuerySuccess_ = on; }
  // The path of a file on this device: the device's path with a file node.
  std::vector<uint8_t> FilePath(const std::u16string &name) const;

 private:
  struct Interface {
    EFI_LOAD_FILE_PROTOCOL loadFile;
    NetworkDevice *self;
  };
  static EFI_STATUS EFIAPI Load(EFI_LOAD_FILE_PROTOCOL *This, EFI_DEVICE_PATH_PROTOCOL *FilePath,
                                BOOLEAN BootPolicy, UINTN *BufferSize, VOID *Buffer);

  Firmware &fw_;
  EFI_HANDLE handle_;
  Interface protocol_;
  std::vector<uint8_t> devicePath_;  // without the end node
  std::map<std::u16string, std::vector<uint8_t>> files_;
  std::vector<LoadFileCall> calls_;
  int skew_ = 0;
  bool sizeQuerySuccess_ = false;
};

// The bytes of a device path node.
std::vector<uint8_t> DevicePathNode(uint8_t type, uint8_t subType, const std::vector<uint8_t> &data);
// A file path media node for `name`, with its terminating zero.
std::vector<uint8_t> FilePathNode(const std::u16string &name);
// The end node of a whole path.
std::vector<uint8_t> EndNode();

}  // namespace hostfw
