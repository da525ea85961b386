// Settling the boot mode, the final option string and the names of kernel
// and driver package from load options, held keys, NVRAM and the
// configuration file.
#include "config/boot_options.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include "efi/vendor.h"
#include "hostfw/network.h"
#include "loader_fixture.h"
#include "support/devicepath.h"
#include "temp_dir.h"

namespace {

using namespace nimb;

struct FakeKeyState {
  NIMB_KEY_STATE_PROTOCOL protocol;
  UINT16 modifiers;
  std::vector<UINT16> keys;
  EFI_STATUS status;
  int calls;
};

EFI_STATUS EFIAPI ReadKeys(NIMB_KEY_STATE_PROTOCOL *This, UINT16 *modifiers, UINTN *count, UINT16 *keys) {
  FakeKeyState *self = reinterpret_cast<FakeKeyState *>(This);
  self->calls++;
  if (EFI_ERROR(self->status))
    return self->status;
  if (*count != 32)
    return EFI_INVALID_PARAMETER;
  *modifiers = self->modifiers;
  *count = self->keys.size();
  for (size_t i = 0; i < self->keys.size(); i++)
    keys[i] = self->keys[i];
  return EFI_SUCCESS;
}

struct FakeBootPolicy {
  NIMB_BOOT_POLICY_PROTOCOL protocol;
  UINT64 answer;
};

// An answer of ~0 stands for a policy that writes nothing.
EFI_STATUS EFIAPI KeysIgnored(NIMB_BOOT_POLICY_PROTOCOL *This, UINT64 *ignored) {
  const UINT64 answer = reinterpret_cast<FakeBootPolicy *>(This)->answer;
  if (answer != ~0ull)
    *ignored = answer;
  return EFI_SUCCESS;
}

// Console text without the dots of file reads.
std::string WithoutDots(std::string text) {
  text.erase(std::remove(text.begin(), text.end(), '.'), text.end());
  return text;
}

std::vector<uint8_t> Bytes(const std::string &text) {
  return std::vector<uint8_t>(text.begin(), text.end());
}

std::string Dict(const std::string &entries) {
  return "<?xml version=\"1.0\"?>\n<plist version=\"1.0\">\n<dict>\n" + entries + "</dict>\n</plist>\n";
}

class BootOptionsTest : public nimbtest::VolumeTest {
 protected:
  void Config(const std::string &entries) {
    Put("Library/Preferences/SystemConfiguration/com.quill.Boot.plist", Dict(entries));
  }
  void BootArgs(const std::string &text) {
    fw.PutVariable(u"boot-args", gNimbVendorVariableGuid, 7, Bytes(text));
  }
  void HoldKeys(UINT16 modifiers, std::vector<UINT16> keys) {
    keys_.protocol.ReadKeyState = ReadKeys;
    keys_.modifiers = modifiers;
    keys_.keys = keys;
    keys_.status = EFI_SUCCESS;
    EFI_HANDLE handle = fw.NewHandle();
    fw.InstallProtocol(handle, gNimbKeyStateProtocolGuid, &keys_);
  }
  EFI_STATUS Process(const std::u16string &options, EFI_LOAD_FILE_INTERFACE *loadFile = nullptr,
                     EFI_FILE *root = nullptr) {
    EFI_STATUS status = EFI_SUCCESS;
    if (loadFile == nullptr && root == nullptr)
      root = root_;
    hostfw::RunResult result =
        fw.Call([&] { status = ProcessBootOptions(loadFile, root, options.c_str(), &gBootOptions); });
    EXPECT_EQ(result.end, hostfw::RunEnd::Returned);
    return status;
  }
  std::string Final() const { return gBootOptions != nullptr ? gBootOptions : "(null)"; }
  static std::u16string Wide(const CHAR16 *text) {
    return text != nullptr ? std::u16string(text) : u"(null)";
  }

  FakeKeyState keys_ = {};
};

TEST_F(BootOptionsTest, TheSourcesMergeFirstComeFirstServed) {
  BootArgs("foo=2 bar=3 -v");
  Config("<key>Kernel Flags</key><string>baz=4 bar=5</string>\n");
  ASSERT_EQ(Process(u"\\x.efi -v foo=1"), EFI_SUCCESS);
  EXPECT_EQ(Final(), "-v foo=1 bar=3 baz=4");
  EXPECT_EQ(gBootFlags, kBootVerbose);
  EXPECT_EQ(Wide(gKernelName), u"nimb_kernel");
  EXPECT_EQ(Wide(gDriverPackageName), u"System\\Library\\Extensions.drvpk");
  EXPECT_EQ(gCustomDriverPackage, 0);
  EXPECT_NE(gConfigDict, nullptr);
  // The configuration file's one chunk.
  EXPECT_EQ(fw.ConOutText(), ".");
  // Only the dictionary stays behind; the file's text, the NVRAM text and the
  // name buffer are given back.
}

TEST_F(BootOptionsTest, OptionStrings) {
  struct Row {
    const char *name;
    std::u16string loadOptions;
    const char *bootArgs;     // null: no variable
    const char *kernelFlags;  // null: no configuration file
    const char *expected;
    UINT64 flags;
    const char *printed;
  } rows[] = {
      {"empty load options", u"", "a=1", "b=2", "a=1 b=2", 0, ""},
      {"blanks only", u"  \t", nullptr, nullptr, "", 0, ""},
      {"a path alone", u"\\EFI\\BOOT\\x.efi", nullptr, nullptr, "", 0, ""},
      {"a bare first word", u"foo -s", nullptr, nullptr, "-s", 0, ""},
      {"a first pair stays", u"rd=x -s", nullptr, nullptr, "rd=x -s", 0, ""},
      {"a flag stays", u"-s", nullptr, nullptr, "-s", 0, ""},
      {"load options win", u"foo=1", "foo=2", nullptr, "foo=1", 0, ""},
      {"-X asks for safe mode", u"-X", "a=1", nullptr, "-X -x", kBootSafeMode, "Using Safe Mode\r\n"},
      {"-x in NVRAM", u"", "-x", nullptr, "-x", kBootSafeMode, ""},
      {"-x in the flags", u"", nullptr, "-x", "-x", kBootSafeMode, ""},
      {"trailing blank in NVRAM", u"-a", "b ", nullptr, "-a b ", 0, ""},
      {"duplicates inside load options stay", u"a=1 a=2", "a=3", nullptr, "a=1 a=2", 0, ""},
  };
  for (const Row &row : rows) {
    hostfw::Firmware local;
    nimbtest::ResetLoaderState();
    nimb::gST = local.SystemTable();
    nimb::gBS = local.BootServices();
    nimb::gRT = local.RuntimeServices();
    nimbtest::TempDir dir;
    if (row.kernelFlags != nullptr) {
      dir.File("Library/Preferences/SystemConfiguration/com.quill.Boot.plist",
               Dict(std::string("<key>Kernel Flags</key><string>") + row.kernelFlags + "</string>"));
    }
    if (row.bootArgs != nullptr)
      local.PutVariable(u"boot-args", gNimbVendorVariableGuid, 7, Bytes(row.bootArgs));
    EFI_HANDLE device = local.AddDirectoryVolume(dir.path());
    local.SetBootDevice(device);
    nimb::gLoadedImage = local.LoadedImage();
    nimb::gBootDevicePath = local.DevicePathOf(device);
    EFI_SIMPLE_FILE_SYSTEM_PROTOCOL *fileSystem = nullptr;
    local.BootServices()->HandleProtocol(device, &gEfiSimpleFileSystemProtocolGuid,
                                         reinterpret_cast<void **>(&fileSystem));
    EFI_FILE *root = nullptr;
    fileSystem->OpenVolume(fileSystem, &root);
    EFI_STATUS status = EFI_ABORTED;
    hostfw::RunResult result = local.Call(
        [&] { status = ProcessBootOptions(nullptr, root, row.loadOptions.c_str(), &gBootOptions); });
    EXPECT_EQ(result.end, hostfw::RunEnd::Returned) << row.name;
    EXPECT_EQ(status, EFI_SUCCESS) << row.name;
    EXPECT_EQ(Final(), row.expected) << row.name;
    EXPECT_EQ(gBootFlags, row.flags) << row.name;
    EXPECT_EQ(WithoutDots(local.ConOutText()), row.printed) << row.name;
    root->Close(root);
    TrackedFreeAll();
  }
  nimbtest::ResetLoaderState();
  Attach();
}

TEST_F(BootOptionsTest, HeldKeys) {
  struct Row {
    const char *name;
    UINT16 modifiers;
    std::vector<UINT16> keys;
    UINT64 flags;
    const char *final;
  } rows[] = {
      {"left shift", 0x02, {}, kBootSafeMode, "-x"},
      {"right shift", 0x20, {}, kBootSafeMode, "-x"},
      {"both shifts", 0x22, {}, kBootSafeMode, "-x"},
      {"shift and a key", 0x02, {0x7004}, 0, ""},
      {"shift and control", 0x03, {}, 0, ""},
      {"GUI-V", 0x08, {kKeyV}, kBootVerbose, "-v"},
      {"right GUI-V", 0x80, {kKeyV}, kBootVerbose, "-v"},
      {"GUI-V with shift", 0x0A, {kKeyV}, kBootVerbose, "-v"},
      {"GUI-S", 0x08, {kKeyS}, kBootSingleUser | kBootVerbose, "-s"},
      {"GUI with two keys", 0x08, {kKeyV, kKeyS}, 0, ""},
      {"V without GUI", 0x00, {kKeyV}, 0, ""},
      {"GUI and another key", 0x08, {0x7004}, 0, ""},
  };
  for (const Row &row : rows) {
    hostfw::Firmware local;
    nimbtest::ResetLoaderState();
    nimb::gST = local.SystemTable();
    nimb::gBS = local.BootServices();
    nimb::gRT = local.RuntimeServices();
    FakeKeyState keys = {{nullptr, ReadKeys}, row.modifiers, row.keys, EFI_SUCCESS, 0};
    local.InstallProtocol(local.NewHandle(), gNimbKeyStateProtocolGuid, &keys);
    EFI_STATUS status = EFI_ABORTED;
    local.Call([&] { status = ProcessBootOptions(nullptr, nullptr, u"", &gBootOptions); });
    EXPECT_EQ(status, EFI_SUCCESS) << row.name;
    EXPECT_EQ(keys.calls, 1) << row.name;
    EXPECT_EQ(gBootFlags, row.flags) << row.name;
    EXPECT_EQ(Final(), row.final) << row.name;
    TrackedFreeAll();
  }
  nimbtest::ResetLoaderState();
  Attach();
}

TEST_F(BootOptionsTest, TheBootPolicyCanSilenceTheKeys) {
  HoldKeys(0x02, {});
  FakeBootPolicy policy = {{{nullptr, nullptr, nullptr, nullptr}, KeysIgnored}, 1};
  fw.InstallProtocol(fw.NewHandle(), gNimbBootPolicyProtocolGuid, &policy);
  ASSERT_EQ(Process(u""), EFI_SUCCESS);
  EXPECT_EQ(keys_.calls, 0);
  EXPECT_EQ(gBootFlags, kBootKeysIgnored);

  // A key state that is not known counts for nothing.
  nimbtest::ResetLoaderState();
  Attach();
  nimb::gLoadedImage = fw.LoadedImage();
  policy.answer = 0;
  keys_.status = EFI_DEVICE_ERROR;
  ASSERT_EQ(Process(u""), EFI_SUCCESS);
  EXPECT_EQ(keys_.calls, 1);
  EXPECT_EQ(gBootFlags, 0u);

  // A policy that writes no answer ignores nothing.
  nimbtest::ResetLoaderState();
  Attach();
  nimb::gLoadedImage = fw.LoadedImage();
  policy.answer = ~0ull;
  ASSERT_EQ(Process(u""), EFI_SUCCESS);
  EXPECT_EQ(gBootFlags & kBootKeysIgnored, 0u);
}

TEST_F(BootOptionsTest, TheConfigurationFileByName) {
  struct Row {
    std::u16string options;
    const char *file;  // written with this content
    const char *opened;
    bool found;
  } rows[] = {
      {u"config=foo", "Library/Preferences/SystemConfiguration/foo.plist",
       "Library\\Preferences\\SystemConfiguration\\foo.plist", true},
      {u"config=/x/foo", "x/foo.plist", "/x/foo.plist", false},
      {u"config=\\x\\foo", "x/foo.plist", "\\x\\foo.plist", true},
      {u"config=missing", "Library/Preferences/SystemConfiguration/foo.plist",
       "Library\\Preferences\\SystemConfiguration\\missing.plist", false},
      {u"", "Library/Preferences/SystemConfiguration/com.quill.Boot.plist",
       "Library\\Preferences\\SystemConfiguration\\com.quill.Boot.plist", true},
  };
  for (const auto &row : rows) {
    TearDown();
    SetUp();
    Put(row.file, Dict("<key>Kernel Flags</key><string>k=1</string>"));
    // NVRAM's config reaches the final string but chooses no file.
    BootArgs("config=nvram");
    ASSERT_EQ(Process(row.options), EFI_SUCCESS);
    bool opened = false;
    for (const std::string &name : fw.OpenedNames())
      opened |= name == row.opened;
    EXPECT_TRUE(opened) << row.opened;
    EXPECT_EQ(Final().find("k=1") != std::string::npos, row.found) << row.opened;
    // With a `config` of its own the load options keep NVRAM's out.
    EXPECT_EQ(Final().find("config=nvram") != std::string::npos, row.options.empty()) << row.opened;
    EXPECT_EQ(WithoutDots(fw.ConOutText()), "") << row.opened;
  }
}

// The name holds 1023 characters and its NUL: "/" and 1016 more with
// ".plist" fit exactly, one more does not.
TEST_F(BootOptionsTest, AConfigValueTooLongForItsBufferReadsNoFile) {
  for (size_t n : {1016u, 1017u, 1100u}) {
    nimbtest::ResetLoaderState();
    Attach();
    nimb::gLoadedImage = fw.LoadedImage();
    const size_t opened = fw.OpenedNames().size();
    ASSERT_EQ(Process(u"config=/" + std::u16string(n, u'a')), EFI_SUCCESS) << n;
    EXPECT_EQ(gConfigDict, nullptr) << n;
    EXPECT_EQ(fw.OpenedNames().size(), opened + (n == 1016 ? 1 : 0)) << n;
  }
}

TEST_F(BootOptionsTest, KernelAndDriverPackageNames) {
  struct Row {
    std::u16string options;
    const char *configEntries;
    std::u16string kernel;
    bool other;
    std::u16string package;
    UINT8 custom;
  } rows[] = {
      {u"Kernel=/nimb_kernel", "", u"\\nimb_kernel", false, u"System\\Library\\Extensions.drvpk", 0},
      {u"Kernel=\\nimb_kernel", "", u"\\nimb_kernel", false, u"System\\Library\\Extensions.drvpk", 0},
      {u"Kernel=nimb_kernel", "", u"nimb_kernel", false, u"System\\Library\\Extensions.drvpk", 0},
      {u"Kernel=nimb_kernelx", "", u"nimb_kernelx", true, u"System\\Library\\Extensions.drvpk", 0},
      {u"Kernel=NIMB_KERNEL", "", u"NIMB_KERNEL", true, u"System\\Library\\Extensions.drvpk", 0},
      {u"Kernel=nimb_kerne", "", u"nimb_kerne", true, u"System\\Library\\Extensions.drvpk", 0},
      {u"Kernel=a/b", "", u"a\\b", true, u"System\\Library\\Extensions.drvpk", 0},
      {u"kernel=\"my k\"", "", u"my k", true, u"System\\Library\\Extensions.drvpk", 0},
      {u"Kernel=opt", "<key>Kernel</key><string>conf</string>", u"opt", true,
       u"System\\Library\\Extensions.drvpk", 0},
      {u"", "<key>Kernel</key><string>conf/k</string>", u"conf\\k", true,
       u"System\\Library\\Extensions.drvpk", 0},
      {u"", "<key>Kernel</key><integer>5</integer>", u"nimb_kernel", false,
       u"System\\Library\\Extensions.drvpk", 0},
      {u"\"Drvpk Cache\"=a/p.drvpk", "", u"nimb_kernel", false, u"a\\p.drvpk", 1},
      {u"", "<key>Drvpk Cache</key><string>c.drvpk</string>", u"nimb_kernel", false, u"c.drvpk", 1},
      {u"Kernel=k\u00e9", "", u"k\u00e9", true, u"System\\Library\\Extensions.drvpk", 0},
  };
  for (const auto &row : rows) {
    TearDown();
    SetUp();
    Config(row.configEntries);
    ASSERT_EQ(Process(row.options), EFI_SUCCESS);
    std::string label(row.options.begin(), row.options.end());
    EXPECT_EQ(Wide(gKernelName), row.kernel) << label;
    EXPECT_EQ((gBootFlags & kBootOtherKernel) != 0, row.other) << label;
    EXPECT_EQ(Wide(gDriverPackageName), row.package) << label;
    EXPECT_EQ(gCustomDriverPackage, row.custom) << label;
  }
}

std::vector<uint8_t> DiskPath() {
  std::vector<uint8_t> path = hostfw::DevicePathNode(HARDWARE_DEVICE_PATH, 1, {0, 1});
  std::vector<uint8_t> file = hostfw::FilePathNode(u"\\k");
  std::vector<uint8_t> end = hostfw::EndNode();
  path.insert(path.end(), file.begin(), file.end());
  path.insert(path.end(), end.begin(), end.end());
  return path;
}

TEST_F(BootOptionsTest, DevicePathVariablesOfTheRightKindOnly) {
  hostfw::NetworkDevice net(fw);
  std::vector<uint8_t> disk = DiskPath();
  std::vector<uint8_t> network = net.FilePath(u"k");
  std::vector<uint8_t> zeroNode = {1, 1, 0, 0, 0x7F, 0xFF, 4, 0};
  std::vector<uint8_t> runsOff = {1, 1, 200, 0, 0, 0};
  // A MAC node with no end behind it, or with a node behind it that runs off.
  std::vector<uint8_t> macOnly(37, 0);
  macOnly[0] = MESSAGING_DEVICE_PATH, macOnly[1] = MSG_MAC_ADDR_DP, macOnly[2] = 37;
  std::vector<uint8_t> macRunsOff = macOnly;
  macRunsOff.insert(macRunsOff.end(), runsOff.begin(), runsOff.end());
  struct Row {
    const char *name;
    std::vector<uint8_t> bytes;
    bool wantMac;
    bool accepted;
  } rows[] = {
      {"disk path, disk boot", disk, false, true},
      {"disk path, network boot", disk, true, false},
      {"network path, network boot", network, true, true},
      {"network path, disk boot", network, false, false},
      {"a node of length 0", zeroNode, false, false},
      {"a node past the variable", runsOff, false, false},
      {"nothing but a MAC node", macOnly, true, false},
      {"a MAC node, then a node past the variable", macRunsOff, true, false},
  };
  for (const Row &row : rows) {
    fw.PutVariable(u"efi-boot-file-data", gNimbVendorVariableGuid, 7, row.bytes);
    size_t pools = fw.LivePoolBlocks();
    EFI_DEVICE_PATH_PROTOCOL *path = nullptr;
    fw.Call([&] { path = GetDevicePathVariable(u"efi-boot-file-data", row.wantMac); });
    EXPECT_EQ(path != nullptr, row.accepted) << row.name;
    if (path != nullptr) {
      EXPECT_EQ(std::vector<uint8_t>(reinterpret_cast<uint8_t *>(path),
                                     reinterpret_cast<uint8_t *>(path) + row.bytes.size()),
                row.bytes)
          << row.name;
      TrackedFree(path);
    }
    EXPECT_LE(fw.LivePoolBlocks(), pools + 1) << row.name;  // the first tag block at most
  }
}

TEST_F(BootOptionsTest, MakeFileDevicePath) {
  hostfw::NetworkDevice net(fw);
  std::vector<uint8_t> image = net.FilePath(u"\\boot\\nimbboot.efi");
  auto make = [&](const std::vector<uint8_t> &path, const char16_t *name, bool replace) {
    EFI_DEVICE_PATH_PROTOCOL *made =
        MakeFileDevicePath(reinterpret_cast<const EFI_DEVICE_PATH_PROTOCOL *>(path.data()), name, replace);
    if (made == nullptr)
      return std::vector<uint8_t>();
    const uint8_t *p = reinterpret_cast<const uint8_t *>(made);
    std::vector<uint8_t> bytes(p, p + DevicePathSize(made));
    TrackedFree(made);
    return bytes;
  };
  EXPECT_EQ(make(image, u"nimb.tarnix", true), net.FilePath(u"\\boot\\nimb.tarnix"));
  EXPECT_EQ(make(image, u".drvpk", false), net.FilePath(u"\\boot\\nimbboot.efi.drvpk"));
  EXPECT_EQ(make(net.FilePath(u"plain"), u"x", true), net.FilePath(u"x"));
  EXPECT_EQ(make(net.FilePath(u"a/b"), u"c", true), net.FilePath(u"a/c"));
  // No file node: nothing to name.
  std::vector<uint8_t> noFile = {1, 1, 6, 0, 0, 1, 0x7F, 0xFF, 4, 0};
  EXPECT_TRUE(make(noFile, u"x", true).empty());
  // Nodes behind the first file node are dropped.
  std::vector<uint8_t> twoFiles = net.FilePath(u"a");
  std::vector<uint8_t> second = hostfw::FilePathNode(u"b");
  twoFiles.insert(twoFiles.end() - 4, second.begin(), second.end());
  EXPECT_EQ(make(twoFiles, u"z", true), net.FilePath(u"z"));
}

TEST_F(BootOptionsTest, ANetworkBootHasItsOwnDefaults) {
  hostfw::NetworkDevice net(fw);
  net.PutFile(u"com.quill.Boot.plist", Bytes(Dict("<key>Kernel Flags</key><string>n=1</string>")));
  std::vector<uint8_t> imagePath = net.FilePath(u"\\tftp\\nimbboot.efi");
  fw.LoadedImage()->FilePath = reinterpret_cast<EFI_DEVICE_PATH_PROTOCOL *>(imagePath.data());
  fw.LoadedImage()->DeviceHandle = net.Handle();
  nimb::gBootDevicePath = fw.DevicePathOf(net.Handle());
  ASSERT_EQ(Process(u"", net.Protocol(), nullptr), EFI_SUCCESS);
  EXPECT_EQ(Final(), "n=1");
  EXPECT_EQ(gBootFlags, kBootNetwork);
  EXPECT_EQ(Wide(gKernelName), u"nimb.tarnix");
  EXPECT_EQ(Wide(gDriverPackageName), u"nimb.tarnix.drvpk");
  auto bytes = [](const EFI_DEVICE_PATH_PROTOCOL *p) {
    const uint8_t *b = reinterpret_cast<const uint8_t *>(p);
    return p != nullptr ? std::vector<uint8_t>(b, b + DevicePathSize(p)) : std::vector<uint8_t>();
  };
  EXPECT_EQ(bytes(gKernelDevicePath), net.FilePath(u"\\tftp\\nimb.tarnix"));
  EXPECT_EQ(bytes(gDriverPackagePath), net.FilePath(u"\\tftp\\nimb.tarnix.drvpk"));
}

TEST_F(BootOptionsTest, ALoadFileDeviceWithoutAMacNodeMakesNoDefaultPaths) {
  hostfw::NetworkDevice net(fw, /*macNode=*/false);
  nimb::gBootDevicePath = fw.DevicePathOf(net.Handle());
  ASSERT_EQ(Process(u"-v", net.Protocol(), nullptr), EFI_SUCCESS);
  EXPECT_EQ(gKernelDevicePath, nullptr);
  EXPECT_EQ(gDriverPackagePath, nullptr);
  EXPECT_EQ(gBootFlags, kBootNetwork | kBootVerbose);
  EXPECT_EQ(Wide(gKernelName), u"nimb.tarnix");
}

TEST_F(BootOptionsTest, OutOfMemoryLeavesNoOptionString) {
  // Pool calls of the run: the load options' copy, the tag block, the NVRAM
  // text, the configuration file's name.
  for (unsigned nth : {1u, 3u, 4u}) {
    TearDown();
    SetUp();
    BootArgs("a=1");
    fw.FailCall("AllocatePool", nth);
    EXPECT_EQ(Process(u"-v"), EFI_OUT_OF_RESOURCES) << nth;
    EXPECT_EQ(gBootOptions, nullptr) << nth;
  }
}

}  // namespace
