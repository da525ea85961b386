// The boot driver: load options, the boot volume and its three directories,
// the call gate's copy, and every way the sequence ends through Fatal.
#include "boot/boot.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <functional>
#include <string>
#include <tuple>
#include <vector>

#include "boot/gate.h"
#include "boot/volume.h"
#include "kernel_images.h"
#include "loader_fixture.h"

namespace {

using nimbtest::TempDir;

EFI_STATUS EFIAPI NoFile(EFI_LOAD_FILE_PROTOCOL *, EFI_DEVICE_PATH_PROTOCOL *, BOOLEAN, UINTN *, VOID *) {
  return EFI_NOT_FOUND;
}

class BootTest : public nimbtest::LoaderTest {
 protected:
  // Reads a small file through the loader's view of a directory.
  static std::string ReadThrough(EFI_FILE *directory, const char16_t *name) {
    EFI_FILE *file = nullptr;
    if (EFI_ERROR(directory->Open(directory, &file, name, EFI_FILE_MODE_READ, 0)))
      return "";
    char buffer[64] = {};
    UINTN size = sizeof(buffer) - 1;
    file->Read(file, &size, buffer);
    file->Close(file);
    return std::string(buffer, size);
  }
};

TEST_F(BootTest, LoadOptionsCopy) {
  struct Row {
    const char *name;
    std::vector<uint8_t> bytes;
    std::u16string expected;
  };
  using nimbtest::Ucs2;
  const Row rows[] = {
      {"empty", {}, u""},
      {"blanks and tabs", Ucs2(std::u16string(u" \t \t", 5)), u""},
      {"no terminator", Ucs2(u" -v"), u"-v"},
      {"leading line feed kept", Ucs2(std::u16string(u"\n -v", 5)), u"\n -v"},
      {"stops at a zero unit", Ucs2(std::u16string(u"a\0b", 4)), u"a"},
      {"trailing blanks kept", Ucs2(u"-s  "), u"-s  "},
  };
  for (const Row &row : rows) {
    fw.SetLoadOptionsBytes(row.bytes);
    CHAR16 *copy = nimb::CopyLoadOptions(fw.LoadedImage());
    ASSERT_NE(copy, nullptr) << row.name;
    EXPECT_EQ(std::u16string(copy), row.expected) << row.name;
  }
  // Null options with a size are no options.
  fw.LoadedImage()->LoadOptions = nullptr;
  fw.LoadedImage()->LoadOptionsSize = 8;
  EXPECT_EQ(std::u16string(nimb::CopyLoadOptions(fw.LoadedImage())), u"");
}

TEST_F(BootTest, TheThreeBootDirectories) {
  struct Row {
    bool r, p, s, kernel;  // the three directories, a kernel in the root
    const char *root;      // which directory becomes the root
    std::vector<std::string> closed;
    bool warning;
  };
  const Row rows[] = {
      {0, 0, 0, 0, "volume", {}, false},
      {1, 0, 0, 0, "R", {}, false},
      {1, 1, 0, 0, "P", {"com.quill.boot.R"}, false},
      {1, 0, 1, 0, "R", {"com.quill.boot.S"}, false},
      {1, 1, 1, 0, "R", {"com.quill.boot.P", "com.quill.boot.S"}, true},
      {1, 1, 1, 1, "volume", {"nimb_kernel"}, false},  // no directory is opened
  };
  const char kWarning[] = "WARNING: all of R,P,S exist: booting from 'R'\r\n";
  for (const Row &row : rows) {
    std::string name = std::string(row.r ? "R" : "-") + (row.p ? "P" : "-") + (row.s ? "S" : "-");
    hostfw::Firmware local;
    TempDir dir;
    dir.File("which", "volume");
    if (row.kernel)
      dir.File("nimb_kernel", "k");
    const bool exists[3] = {row.r, row.p, row.s};
    for (int i = 0; i < 3; i++) {
      if (exists[i])
        dir.File(std::string(nimb::kBootDirectoryNames[i]) + "/which", std::string(1, "RPS"[i]));
    }

    nimbtest::AttachTo(local);
    EFI_HANDLE device = local.AddDirectoryVolume(dir.path());
    // A file system is preferred to a LoadFile protocol on the same device.
    static EFI_LOAD_FILE_PROTOCOL loadFile = {NoFile};
    local.InstallProtocol(device, gEfiLoadFileProtocolGuid, &loadFile);
    nimb::BootVolume volume = {};
    hostfw::RunResult result = local.Call([&] { volume = nimb::OpenBootVolume(device); });
    ASSERT_EQ(result.end, hostfw::RunEnd::Returned) << name;
    EXPECT_EQ(volume.loadFile, nullptr) << name;
    ASSERT_NE(volume.root, nullptr) << name;
    EXPECT_EQ(local.ClosedNames(), row.closed) << name;
    EXPECT_EQ(ReadThrough(volume.root, u"which"), row.root) << name;
    EXPECT_EQ(local.ConOutText(), row.warning ? kWarning : "") << name;
    // The probe, then all three names, whatever the first ones gave.
    ASSERT_GE(local.OpenedNames().size(), row.kernel ? 2u : 5u) << name;
    EXPECT_EQ(local.OpenedNames()[0], "nimb_kernel") << name;
    EXPECT_EQ(local.OpenedNames()[row.kernel ? 1 : 3], row.kernel ? "which" : "com.quill.boot.S") << name;
  }
}

TEST_F(BootTest, TheCallGateIsCopiedBelow4GiB) {
  EXPECT_EQ(nimb::CallGateSize(), 0x82u);
  ASSERT_EQ(nimb::CopyCallGate(), EFI_SUCCESS);
  EXPECT_LE(nimb::gCallGate + 0x81, 0xFFFFFFFFull);
  EXPECT_EQ(nimb::gCallGate % EFI_PAGE_SIZE, 0u);
  EXPECT_EQ(fw.AllocatedPages(), 1u);
  const auto *copy = reinterpret_cast<const uint8_t *>(nimb::gCallGate);
  EXPECT_EQ(std::vector<uint8_t>(copy, copy + 0x82), std::vector<uint8_t>(CallGateStart, CallGateEnd));
  // The rest of the page is left as the firmware gave it.
  EXPECT_EQ(copy[0x82], 0xAF);
}

TEST_F(BootTest, EveryFatalMessageOfTheBootSequence) {
  static EFI_LOAD_FILE_PROTOCOL loadFile = {NoFile};
  struct Row {
    const char *message;
    std::function<void(hostfw::Firmware &, EFI_HANDLE device)> arrange;
  };
  const Row rows[] = {
      {"Can not initialize console\r\n",
       [](hostfw::Firmware &f, EFI_HANDLE) { f.SetConsoleControlPresent(false); }},
      {"Can not initialize console\r\n", [](hostfw::Firmware &f, EFI_HANDLE) { f.FailCall("GetMode"); }},
      {"Could not allocate kernel call gate (9)\r\n",
       [](hostfw::Firmware &f, EFI_HANDLE) { f.FailCall("AllocatePages", 1, EFI_OUT_OF_RESOURCES); }},
      {"Can not retrieve a LoadedImageProtocol handle for ImageHandle\r\n",
       [](hostfw::Firmware &f, EFI_HANDLE) {
         f.FailCall("HandleProtocol", 1, EFI_UNSUPPORTED, &gEfiLoadedImageProtocolGuid);
       }},
      {"Can not find a DevicePath handle for LoadedImage->DeviceHandle\r\n",
       [](hostfw::Firmware &f, EFI_HANDLE device) {
         f.UninstallProtocol(device, gEfiDevicePathProtocolGuid);
       }},
      // The copy of "  -v": two characters and a terminator.
      {"Could not get boot args\r\n", [](hostfw::Firmware &f, EFI_HANDLE) { f.FailPoolAllocationOfSize(6); }},
      {"Can't open booter's root volume\r\n",
       [](hostfw::Firmware &f, EFI_HANDLE) { f.FailCall("OpenVolume"); }},
      {"Can't get a FileSystem or LoadFile handle for boot volume\r\n",
       [](hostfw::Firmware &f, EFI_HANDLE device) {
         f.UninstallProtocol(device, gEfiSimpleFileSystemProtocolGuid);
       }},
      {"Error loading kernel 'nimb_kernel'\r\n", [](hostfw::Firmware &, EFI_HANDLE) {}},
      {"Error loading kernel 'nimb.tarnix'\r\n",
       [](hostfw::Firmware &f, EFI_HANDLE device) {
         f.UninstallProtocol(device, gEfiSimpleFileSystemProtocolGuid);
         f.InstallProtocol(device, gEfiLoadFileProtocolGuid, &loadFile);
       }},
  };
  for (const Row &row : rows) {
    for (auto mode : {EfiConsoleControlScreenText, EfiConsoleControlScreenGraphics}) {
      hostfw::Firmware local;
      local.SetConsoleMode(mode);
      TempDir dir;
      EFI_HANDLE device = local.AddDirectoryVolume(dir.path());
      local.SetBootDevice(device);
      local.SetLoadOptions(u"  -v");
      row.arrange(local, device);
      nimbtest::ResetLoaderState();
      hostfw::RunResult result = local.Run(BootEntry);
      // Exits with the message last, the console's mode back and nothing held.
      const std::string text = local.ConOutText();
      const size_t tail = std::min(text.size(), strlen(row.message));
      EXPECT_EQ(
          std::make_tuple(result.end, result.status, text.substr(text.size() - tail), local.ConsoleMode(),
                          local.LivePoolBlocks() + local.AllocatedPages(), nimb::gMemoryTags == nullptr),
          std::make_tuple(hostfw::RunEnd::Exited, EFI_ABORTED, std::string(row.message), mode, size_t{0},
                          true));
    }
  }
}

// A whole boot into a small kernel; a kernel that comes back through the
// gate stops the machine with its message, touching no boot service.
TEST_F(BootTest, TheKernelIsEnteredAndAReturnStops) {
  using nimbtest::Object;
  const nimbtest::Bytes kernel = Object{0xFEEDFACE,
                                        {nimbtest::Segment(0x200000, 0x10, nimbtest::kObjectDataStart, 0x10),
                                         nimbtest::Thread(0x200004)},
                                        nimbtest::Pattern(0x10)}
                                     .Build();
  for (bool returns : {false, true}) {
    hostfw::Firmware local;
    TempDir dir;
    dir.File("nimb_kernel", kernel);
    dir.Directory("System/Library/Extensions");  // a plain kernel's drivers, none
    local.SetBootDevice(local.AddDirectoryVolume(dir.path()));
    local.SetGateReturns(returns);
    nimbtest::ResetLoaderState();
    hostfw::RunResult result = local.Run(BootEntry);
    EXPECT_EQ(result.end, returns ? hostfw::RunEnd::Halted : hostfw::RunEnd::KernelEntered);
    EXPECT_EQ(result.gateTarget, 0x200004u);
    EXPECT_TRUE(local.ViolationsAfterExit().empty());
    EXPECT_STREQ(nimb::gStopMessage, returns ? "Kernel entry failed\n" : nullptr);
  }
}

}  // namespace
