// Host tests of the platform layer's network file loader: its LoadFile
// answers over a fake TFTP server behind a fake PXE base code, and the
// length it gives a DHCP message.
#include <gtest/gtest.h>

#include <cstring>
#include <map>
#include <string>
#include <vector>

#include "../../platform/net_boot.h"
#include "../../platform/net_load_file.h"

namespace nimb::platform {
namespace {

// A TFTP server as the base code sees it: files by name, each listed with a
// size that may differ from what a read delivers.
struct FakePxe {
  EFI_PXE_BASE_CODE_PROTOCOL protocol = {};
  EFI_PXE_BASE_CODE_MODE mode = {};
  struct File {
    std::string bytes;
    UINT64 listed;
  };
  std::map<std::string, File> files;
  EFI_STATUS failure = EFI_SUCCESS;  // every transfer fails with this
  std::vector<std::string> requests;

  FakePxe() {
    protocol.Mtftp = Mtftp;
    protocol.Mode = &mode;
  }

  static EFI_STATUS EFIAPI Mtftp(EFI_PXE_BASE_CODE_PROTOCOL *This, EFI_PXE_BASE_CODE_TFTP_OPCODE Operation,
                                 VOID *BufferPtr, BOOLEAN, UINT64 *BufferSize, UINTN *BlockSize,
                                 EFI_IP_ADDRESS *, UINT8 *Filename, EFI_PXE_BASE_CODE_MTFTP_INFO *, BOOLEAN) {
    FakePxe *self = reinterpret_cast<FakePxe *>(This);
    const std::string name = reinterpret_cast<const char *>(Filename);
    self->requests.push_back(std::to_string(Operation) + " " + name + " " + std::to_string(*BlockSize));
    if (self->failure != EFI_SUCCESS) {
      return self->failure;
    }
    const auto found = self->files.find(name);
    if (found == self->files.end()) {
      return EFI_TFTP_ERROR;
    }
    if (Operation == EFI_PXE_BASE_CODE_TFTP_GET_FILE_SIZE) {
      *BufferSize = found->second.listed;
      return EFI_SUCCESS;
    }
    const std::string &bytes = found->second.bytes;
    if (bytes.size() > *BufferSize) {
      return EFI_BUFFER_TOO_SMALL;
    }
    std::memcpy(BufferPtr, bytes.data(), bytes.size());
    *BufferSize = bytes.size();
    return EFI_SUCCESS;
  }
};

// A device path: the NIC's nodes, a file node of `name`, the end.
std::vector<UINT8> PathOf(const std::u16string &name) {
  std::vector<UINT8> path;
  auto node = [&path](UINT8 type, UINT8 subType, const std::vector<UINT8> &body) {
    const UINTN length = 4 + body.size();
    path.insert(path.end(), {type, subType, static_cast<UINT8>(length), static_cast<UINT8>(length >> 8)});
    path.insert(path.end(), body.begin(), body.end());
  };
  node(HARDWARE_DEVICE_PATH, 1, {0, 2});
  std::vector<UINT8> mac(33, 0);
  mac[0] = 0x52;
  mac[32] = 1;
  node(MESSAGING_DEVICE_PATH, MSG_MAC_ADDR_DP, mac);
  std::vector<UINT8> text;
  for (const char16_t unit : name + u'\0') {
    text.push_back(static_cast<UINT8>(unit));
    text.push_back(static_cast<UINT8>(unit >> 8));
  }
  node(MEDIA_DEVICE_PATH, MEDIA_FILEPATH_DP, text);
  node(END_DEVICE_PATH_TYPE, END_ENTIRE_DEVICE_PATH_SUBTYPE, {});
  return path;
}

TEST(PlatformNetLoadFile, AnswersAsALoadFile) {
  const std::string kernel(5000, 'k');
  struct Row {
    const char *name;
    std::u16string file;
    UINTN room;          // 0: a size query with a null buffer
    EFI_STATUS failure;  // of every transfer
    EFI_STATUS status;
    UINTN size;  // written back
    size_t requests;
  };
  const std::vector<Row> rows = {
      {"size query", u"nimb.tarnix", 0, EFI_SUCCESS, EFI_BUFFER_TOO_SMALL, 5000, 1},
      {"fetch into the exact size", u"nimb.tarnix", 5000, EFI_SUCCESS, EFI_SUCCESS, 5000, 1},
      {"fetch into more room", u"nimb.tarnix", 9000, EFI_SUCCESS, EFI_SUCCESS, 5000, 1},
      {"too little room: the size", u"nimb.tarnix", 100, EFI_SUCCESS, EFI_BUFFER_TOO_SMALL, 5000, 2},
      {"missing file, size query", u"missing", 0, EFI_SUCCESS, EFI_NOT_FOUND, 0, 1},
      {"missing file, fetch", u"missing", 100, EFI_SUCCESS, EFI_NOT_FOUND, 100, 1},
      {"listed larger than delivered", u"short", 5000, EFI_SUCCESS, EFI_SUCCESS, 3000, 1},
      {"grown since it was listed", u"grown", 5000, EFI_SUCCESS, EFI_BUFFER_TOO_SMALL, 6000, 2},
      {"empty file", u"empty", 0, EFI_SUCCESS, EFI_SUCCESS, 0, 1},
      {"server gone", u"nimb.tarnix", 5000, EFI_TIMEOUT, EFI_TIMEOUT, 5000, 1},
      {"name too long", std::u16string(kMaxTftpNameLength + 1, u'a'), 0, EFI_SUCCESS, EFI_INVALID_PARAMETER,
       0, 0},
      {"longest name", std::u16string(kMaxTftpNameLength, u'a'), 0, EFI_SUCCESS, EFI_NOT_FOUND, 0, 1},
      {"character beyond ASCII", u"k\u00e9rnel", 0, EFI_SUCCESS, EFI_INVALID_PARAMETER, 0, 0},
      {"no name", u"\\", 0, EFI_SUCCESS, EFI_INVALID_PARAMETER, 0, 0},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(row.name);
    FakePxe pxe;
    pxe.files = {{"nimb.tarnix", {kernel, kernel.size()}},
                 {"short", {std::string(3000, 's'), 5000}},
                 {"grown", {std::string(6000, 'g'), 6000}},
                 {"empty", {"", 0}}};
    pxe.failure = row.failure;
    PlatformNetLoadFile loader;
    NetLoadFileInit(&loader, &pxe.protocol, EFI_IP_ADDRESS{});
    std::vector<UINT8> path = PathOf(row.file);
    std::vector<char> buffer(row.room);
    UINTN size = row.room;
    const EFI_STATUS status =
        loader.protocol.LoadFile(&loader.protocol, reinterpret_cast<EFI_DEVICE_PATH_PROTOCOL *>(path.data()),
                                 FALSE, &size, row.room == 0 ? nullptr : buffer.data());
    EXPECT_EQ(status, row.status);
    EXPECT_EQ(size, row.size);
    EXPECT_EQ(pxe.requests.size(), row.requests);
    if (status == EFI_SUCCESS && row.room != 0 && row.file == u"nimb.tarnix") {
      EXPECT_EQ(std::string(buffer.data(), size), kernel);
    }
    for (const std::string &request : pxe.requests) {
      EXPECT_NE(request.find(" " + std::to_string(kTftpBlockSize)), std::string::npos);
    }
  }
}

TEST(PlatformNetLoadFile, FetchesWholeFilesAndSeesMismatches) {
  FakePxe pxe;
  pxe.files = {{"platform.cfg", {"console=text\n", 13}}, {"short", {"abc", 4}}};
  PlatformNetLoadFile loader;
  NetLoadFileInit(&loader, &pxe.protocol, EFI_IP_ADDRESS{});
  static std::vector<std::vector<char>> buffers;
  auto allocate = [](UINTN size) -> void * {
    buffers.emplace_back(size + 1);
    return buffers.back().data();
  };
  void *bytes = nullptr;
  UINT64 size = 0;
  EXPECT_EQ(NetLoadFileFetch(&loader, "platform.cfg", allocate, &bytes, &size), EFI_SUCCESS);
  EXPECT_EQ(std::string(static_cast<char *>(bytes), size), "console=text\n");
  EXPECT_EQ(NetLoadFileFetch(&loader, "short", allocate, &bytes, &size), EFI_END_OF_FILE);
  EXPECT_EQ(size, 3u);
  EXPECT_EQ(NetLoadFileFetch(&loader, "missing", allocate, &bytes, &size), EFI_NOT_FOUND);
  EXPECT_EQ(bytes, nullptr);
  const std::string longName(kMaxTftpNameLength + 1, 'n');
  EXPECT_EQ(NetLoadFileFetch(&loader, longName.c_str(), allocate, &bytes, &size), EFI_INVALID_PARAMETER);
  EXPECT_EQ(pxe.requests.size(), 5u);  // two for each file that came, one for the missing one
}

TEST(PlatformNetBoot, DhcpMessageLength) {
  std::vector<UINT8> packet(1472, 0);
  const UINT8 magic[] = {99, 130, 83, 99};
  std::memcpy(&packet[236], magic, 4);
  const std::vector<UINT8> options = {53, 1, 5, 0, 1, 4, 255, 255, 255, 0, 255};
  std::memcpy(&packet[240], options.data(), options.size());
  EXPECT_EQ(DhcpMessageLength(packet.data(), packet.size()), 240 + options.size());
  packet[240 + options.size() - 1] = 0;  // no end option: the whole packet
  EXPECT_EQ(DhcpMessageLength(packet.data(), packet.size()), packet.size());
  packet[251] = 3;  // an option that runs past the end
  packet[252] = 200;
  EXPECT_EQ(DhcpMessageLength(packet.data(), 300), 300u);
  packet[236] = 0;  // no magic cookie: plain BOOTP
  EXPECT_EQ(DhcpMessageLength(packet.data(), packet.size()), 300u);
}

}  // namespace
}  // namespace nimb::platform
