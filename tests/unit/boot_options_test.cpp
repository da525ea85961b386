// Settling the boot mode, the final option string and the names of kernel
// and driver package from load options, held keys, NVRAM and the
// configuration file.
#include "config/boot_options.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <cstring>
#include <string>
#include <vector>

#include "config/options.h"
#include "config/plist.h"
#include "efi/vendor.h"
#include "hostfw/network.h"
#include "loader_fixture.h"
#include "support/devicepath.h"

namespace {

using namespace nimb;
using Bytes = std::vector<uint8_t>;

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
  if (EFI_ERROR(self->status) || *count != 32)
    return EFI_ERROR(self->status) ? self->status : EFI_INVALID_PARAMETER;
  *modifiers = self->modifiers;
  *count = self->keys.size();
  std::copy(self->keys.begin(), self->keys.end(), keys);
  return EFI_SUCCESS;
}

struct FakeBootPolicy {
  NIMB_BOOT_POLICY_PROTOCOL protocol;
  UINT64 answer;  // ~0: the policy writes nothing
};

EFI_STATUS EFIAPI KeysIgnored(NIMB_BOOT_POLICY_PROTOCOL *This, UINT64 *ignored) {
  const UINT64 answer = reinterpret_cast<FakeBootPolicy *>(This)->answer;
  if (answer != ~0ull)
    *ignored = answer;
  return EFI_SUCCESS;
}

Bytes ToBytes(const std::string &text) {
  return Bytes(text.begin(), text.end());
}

std::string Dict(const std::string &entries) {
  return "<?xml version=\"1.0\"?>\n<plist version=\"1.0\">\n<dict>\n" + entries + "</dict>\n</plist>\n";
}

std::string Flags(const std::string &flags) {
  return "<key>Kernel Flags</key><string>" + flags + "</string>";
}

Bytes PathBytes(const EFI_DEVICE_PATH_PROTOCOL *p) {
  const uint8_t *b = reinterpret_cast<const uint8_t *>(p);
  return p != nullptr ? Bytes(b, b + DevicePathSize(p)) : Bytes();
}

class BootOptionsTest : public nimbtest::VolumeTest {
 protected:
  // A fresh start: volume, NVRAM's boot-args and the loader's state.
  void Restart() {
    TearDown();
    SetUp();
    fw.RuntimeServices()->SetVariable(u"boot-args", &gNimbVendorVariableGuid, 0, 0, nullptr);
    printedBefore_ = fw.ConOutText().size();
  }
  void Config(const std::string &entries) {
    Put("Library/Preferences/SystemConfiguration/com.quill.Boot.plist", Dict(entries));
  }
  void BootArgs(const std::string &text) {
    fw.PutVariable(u"boot-args", gNimbVendorVariableGuid, 7, ToBytes(text));
  }
  EFI_STATUS Process(const std::u16string &options, EFI_LOAD_FILE_INTERFACE *loadFile = nullptr) {
    EFI_STATUS status = EFI_ABORTED;
    EFI_FILE *root = loadFile == nullptr ? root_ : nullptr;
    EXPECT_EQ(
        fw.Call([&] { status = ProcessBootOptions(loadFile, root, options.c_str(), &gBootOptions); }).end,
        hostfw::RunEnd::Returned);
    return status;
  }
  std::string Final() const { return gBootOptions != nullptr ? gBootOptions : "(null)"; }
  // Console text since the last restart, without the dots of file reads.
  std::string Printed() {
    std::string text = fw.ConOutText().substr(printedBefore_);
    text.erase(std::remove(text.begin(), text.end(), '.'), text.end());
    return text;
  }
  static std::u16string Wide(const CHAR16 *text) {
    return text != nullptr ? std::u16string(text) : u"(null)";
  }
  size_t printedBefore_ = 0;
};

TEST_F(BootOptionsTest, OptionStrings) {
  struct Row {
    std::u16string loadOptions;
    const char *bootArgs;     // null: no variable
    const char *kernelFlags;  // null: no configuration file
    const char *expected;
    UINT64 flags;
    const char *printed;
  } rows[] = {
      {u"\\x.efi -v foo=1", "foo=2 bar=3 -v", "baz=4 bar=5", "-v foo=1 bar=3 baz=4", kBootVerbose, ""},
      {u"\\EFI\\BOOT\\x.efi", nullptr, nullptr, "", 0, ""},
      {u"foo -s", nullptr, nullptr, "-s", 0, ""},
      {u"rd=x -s", nullptr, nullptr, "rd=x -s", 0, ""},
      {u"-X", "a=1", nullptr, "-X -x", kBootSafeMode, "Using Safe Mode\r\n"},
      {u"", "-x", nullptr, "-x", kBootSafeMode, ""},
      {u"-a", "b ", nullptr, "-a b ", 0, ""},
      {u"a=1 a=2", "a=3", nullptr, "a=1 a=2", 0, ""},
  };
  for (const Row &row : rows) {
    Restart();
    if (row.kernelFlags != nullptr)
      Config(Flags(row.kernelFlags));
    if (row.bootArgs != nullptr)
      BootArgs(row.bootArgs);
    const std::string name(row.loadOptions.begin(), row.loadOptions.end());
    EXPECT_EQ(Process(row.loadOptions), EFI_SUCCESS) << name;
    EXPECT_EQ(Final(), row.expected) << name;
    EXPECT_EQ(gBootFlags, row.flags) << name;
    EXPECT_EQ(Printed(), row.printed) << name;
  }
}

TEST_F(BootOptionsTest, HeldKeysAndTheBootPolicy) {
  struct Row {
    const char *name;
    UINT16 modifiers;
    std::vector<UINT16> keys;
    UINT64 policy;  // 2: none installed; ~0: one that answers nothing
    EFI_STATUS keyStatus;
    UINT64 flags;
    const char *final;
  } rows[] = {
      {"left shift", 0x02, {}, 2, EFI_SUCCESS, kBootSafeMode, "-x"},
      {"right shift", 0x20, {}, 0, EFI_SUCCESS, kBootSafeMode, "-x"},
      {"shift and a key", 0x02, {0x7004}, 2, EFI_SUCCESS, 0, ""},
      {"shift and control", 0x03, {}, 2, EFI_SUCCESS, 0, ""},
      {"GUI-V with shift", 0x0A, {kKeyV}, 2, EFI_SUCCESS, kBootVerbose, "-v"},
      {"right GUI-S", 0x80, {kKeyS}, 2, EFI_SUCCESS, kBootSingleUser | kBootVerbose, "-s"},
      {"GUI with two keys", 0x08, {kKeyV, kKeyS}, 2, EFI_SUCCESS, 0, ""},
      {"V without GUI", 0x00, {kKeyV}, 2, EFI_SUCCESS, 0, ""},
      {"keys ignored", 0x02, {}, 1, EFI_SUCCESS, kBootKeysIgnored, ""},
      {"a policy without an answer", 0x02, {}, ~0ull, EFI_SUCCESS, kBootSafeMode, "-x"},
      {"key state not known", 0x02, {}, 0, EFI_DEVICE_ERROR, 0, ""},
  };
  for (const Row &row : rows) {
    Restart();
    FakeKeyState keys = {{nullptr, ReadKeys}, row.modifiers, row.keys, row.keyStatus, 0};
    const EFI_HANDLE handle = fw.NewHandle();
    fw.InstallProtocol(handle, gNimbKeyStateProtocolGuid, &keys);
    FakeBootPolicy policy = {{{nullptr, nullptr, nullptr, nullptr}, KeysIgnored}, row.policy};
    if (row.policy != 2)
      fw.InstallProtocol(handle, gNimbBootPolicyProtocolGuid, &policy);
    EXPECT_EQ(Process(u""), EFI_SUCCESS) << row.name;
    EXPECT_EQ(keys.calls, row.policy == 1 ? 0 : 1) << row.name;
    EXPECT_EQ(gBootFlags, row.flags) << row.name;
    EXPECT_EQ(Final(), row.final) << row.name;
    fw.UninstallProtocol(handle, gNimbKeyStateProtocolGuid);
    if (row.policy != 2)
      fw.UninstallProtocol(handle, gNimbBootPolicyProtocolGuid);
  }
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
      {u"", "Library/Preferences/SystemConfiguration/com.quill.Boot.plist",
       "Library\\Preferences\\SystemConfiguration\\com.quill.Boot.plist", true},
  };
  for (const auto &row : rows) {
    Restart();
    Put(row.file, Dict(Flags("k=1")));
    // NVRAM's config reaches the final string but chooses no file.
    BootArgs("config=nvram");
    ASSERT_EQ(Process(row.options), EFI_SUCCESS);
    const std::vector<std::string> &names = fw.OpenedNames();
    EXPECT_NE(std::find(names.begin(), names.end(), row.opened), names.end()) << row.opened;
    EXPECT_EQ(Final().find("k=1") != std::string::npos, row.found) << row.opened;
    EXPECT_EQ(Final().find("config=nvram") != std::string::npos, row.options.empty()) << row.opened;
  }
  // The name holds 1023 characters and its NUL: "/" and 1016 more with
  // ".plist" fit exactly, one more does not.
  for (size_t n : {1016u, 1017u}) {
    Restart();
    const size_t opened = fw.OpenedNames().size();
    ASSERT_EQ(Process(u"config=/" + std::u16string(n, u'a')), EFI_SUCCESS) << n;
    EXPECT_EQ(fw.OpenedNames().size(), opened + (n == 1016 ? 1 : 0)) << n;
  }
}

TEST_F(BootOptionsTest, KernelAndDriverPackageNames) {
  const std::u16string package = u"System\\Library\\Extensions.drvpk";
  struct Row {
    std::u16string options;
    const char *configEntries;
    std::u16string kernel;
    bool other;
    std::u16string package;
  } rows[] = {
      {u"Kernel=/nimb_kernel", "", u"\\nimb_kernel", false, package},
      {u"Kernel=nimb_kernelx", "", u"nimb_kernelx", true, package},
      {u"Kernel=nimb_kerne", "", u"nimb_kerne", true, package},
      {u"kernel=\"a/k\u00e9\"", "", u"a\\k\u00e9", true, package},
      {u"Kernel=opt", "<key>Kernel</key><string>conf</string>", u"opt", true, package},
      {u"", "<key>Kernel</key><string>conf/k</string>", u"conf\\k", true, package},
      {u"", "<key>Kernel</key><integer>5</integer>", u"nimb_kernel", false, package},
      {u"\"Drvpk Cache\"=a/p.drvpk", "", u"nimb_kernel", false, u"a\\p.drvpk"},
      {u"", "<key>Drvpk Cache</key><string>c.drvpk</string>", u"nimb_kernel", false, u"c.drvpk"},
  };
  for (const auto &row : rows) {
    Restart();
    Config(row.configEntries);
    ASSERT_EQ(Process(row.options), EFI_SUCCESS);
    std::string label(row.options.begin(), row.options.end());
    EXPECT_EQ(Wide(gKernelName), row.kernel) << label;
    EXPECT_EQ((gBootFlags & kBootOtherKernel) != 0, row.other) << label;
    EXPECT_EQ(Wide(gDriverPackageName), row.package) << label;
    EXPECT_EQ(gCustomDriverPackage, row.package != package) << label;
  }
}

TEST_F(BootOptionsTest, DevicePathVariablesOfTheRightKindOnly) {
  hostfw::NetworkDevice net(fw);
  Bytes disk = hostfw::DevicePathNode(HARDWARE_DEVICE_PATH, 1, {0, 1});
  for (const Bytes &node : {hostfw::FilePathNode(u"\\k"), hostfw::EndNode()})
    disk.insert(disk.end(), node.begin(), node.end());
  const Bytes runsOff = {1, 1, 200, 0, 0, 0};
  // A MAC node with no end behind it, or with a node behind it that runs off.
  Bytes macOnly(37, 0);
  macOnly[0] = MESSAGING_DEVICE_PATH, macOnly[1] = MSG_MAC_ADDR_DP, macOnly[2] = 37;
  Bytes macRunsOff = macOnly;
  macRunsOff.insert(macRunsOff.end(), runsOff.begin(), runsOff.end());
  struct Row {
    const char *name;
    Bytes bytes;
    bool wantMac;
    bool accepted;
  } rows[] = {
      {"disk path, disk boot", disk, false, true},
      {"disk path, network boot", disk, true, false},
      {"network path, network boot", net.FilePath(u"k"), true, true},
      {"network path, disk boot", net.FilePath(u"k"), false, false},
      {"a node of length 0", {1, 1, 0, 0, 0x7F, 0xFF, 4, 0}, false, false},
      {"a node past the variable", runsOff, false, false},
      {"nothing but a MAC node", macOnly, true, false},
      {"a MAC node, then a node past the variable", macRunsOff, true, false},
  };
  for (const Row &row : rows) {
    fw.PutVariable(u"efi-boot-file-data", gNimbVendorVariableGuid, 7, row.bytes);
    EFI_DEVICE_PATH_PROTOCOL *path = nullptr;
    fw.Call([&] { path = GetDevicePathVariable(u"efi-boot-file-data", row.wantMac); });
    EXPECT_EQ(path != nullptr, row.accepted) << row.name;
    if (path != nullptr)
      EXPECT_EQ(PathBytes(path), row.bytes) << row.name;
  }
}

TEST_F(BootOptionsTest, MakeFileDevicePath) {
  hostfw::NetworkDevice net(fw);
  auto make = [&](const Bytes &path, const char16_t *name, bool replace) {
    return PathBytes(
        MakeFileDevicePath(reinterpret_cast<const EFI_DEVICE_PATH_PROTOCOL *>(path.data()), name, replace));
  };
  const Bytes image = net.FilePath(u"\\boot\\nimbboot.efi");
  EXPECT_EQ(make(image, u"nimb.tarnix", true), net.FilePath(u"\\boot\\nimb.tarnix"));
  EXPECT_EQ(make(image, u".drvpk", false), net.FilePath(u"\\boot\\nimbboot.efi.drvpk"));
  EXPECT_EQ(make(net.FilePath(u"plain"), u"x", true), net.FilePath(u"x"));
  EXPECT_EQ(make(net.FilePath(u"a/b"), u"c", true), net.FilePath(u"a/c"));
  EXPECT_TRUE(make({1, 1, 6, 0, 0, 1, 0x7F, 0xFF, 4, 0}, u"x", true).empty()) << "no file node";
  // Nodes behind the first file node are dropped.
  Bytes twoFiles = net.FilePath(u"a");
  const Bytes second = hostfw::FilePathNode(u"b");
  twoFiles.insert(twoFiles.end() - 4, second.begin(), second.end());
  EXPECT_EQ(make(twoFiles, u"z", true), net.FilePath(u"z"));
}

TEST_F(BootOptionsTest, ANetworkBootHasItsOwnDefaults) {
  hostfw::NetworkDevice withMac(fw), withoutMac(fw, false);
  for (hostfw::NetworkDevice *device : {&withMac, &withoutMac}) {
    hostfw::NetworkDevice &net = *device;
    const bool mac = device == &withMac;
    Restart();
    net.PutFile(u"com.quill.Boot.plist", ToBytes(Dict(Flags("n=1"))));
    Bytes imagePath = net.FilePath(u"\\tftp\\nimbboot.efi");
    fw.LoadedImage()->FilePath = reinterpret_cast<EFI_DEVICE_PATH_PROTOCOL *>(imagePath.data());
    nimb::gBootDevicePath = fw.DevicePathOf(net.Handle());
    ASSERT_EQ(Process(u"", net.Protocol()), EFI_SUCCESS);
    EXPECT_EQ(Final(), "n=1");
    EXPECT_EQ(gBootFlags, kBootNetwork);
    EXPECT_EQ(Wide(gKernelName), u"nimb.tarnix");
    EXPECT_EQ(Wide(gDriverPackageName), u"nimb.tarnix.drvpk");
    // Without a MAC node no default paths are made.
    EXPECT_EQ(PathBytes(gKernelDevicePath), mac ? net.FilePath(u"\\tftp\\nimb.tarnix") : Bytes());
    EXPECT_EQ(PathBytes(gDriverPackagePath), mac ? net.FilePath(u"\\tftp\\nimb.tarnix.drvpk") : Bytes());
  }
}

TEST_F(BootOptionsTest, OutOfMemoryLeavesNoOptionString) {
  // Pool calls of the run: the load options' copy, the tag block, the NVRAM
  // text, the configuration file's name.
  for (unsigned nth : {1u, 3u, 4u}) {
    Restart();
    BootArgs("a=1");
    fw.FailCall("AllocatePool", nth);
    EXPECT_EQ(Process(u"-v"), EFI_OUT_OF_RESOURCES) << nth;
    EXPECT_EQ(gBootOptions, nullptr) << nth;
  }
}

// Word and key, as NextOption splits `text` up to the terminator.
using Words = std::vector<std::pair<std::string, std::string>>;
Words Split(const char *text) {
  Words words;
  while (*text != '\0') {
    const char *word = nullptr;
    UINT64 keyLength = 0;
    UINT64 wordLength = 0;
    const char *next = nimb::NextOption(text, &word, &keyLength, &wordLength);
    EXPECT_EQ(next, word + wordLength);
    words.push_back({std::string(word, wordLength), std::string(word, keyLength)});
    text = next;
  }
  return words;
}

class OptionsAppendTest : public nimbtest::LoaderTest {};

// The same rows with the plain search and with the key index.
TEST_F(OptionsAppendTest, AppendOptionDropsWordsWhoseKeyIsInTheTextAlready) {
  struct Row {
    const char *base;
    std::vector<const char *> sources;  // each split into words with NextOption
    const char *result;
  };
  const Row rows[] = {
      {"", {"a b"}, "a b"},
      {"-v", {"-v"}, "-v"},
      {"-v", {"-v=1"}, "-v"},
      {"-vx", {"-v"}, "-vx -v"},
      {"-V", {"-v"}, "-V -v"},
      {"x\t-v\r\n", {"-v"}, "x\t-v\r\n"},
      {"a=\"x -v y\"", {"-v"}, "a=\"x -v y\""},
      {"", {"a=\"b c\" a=1"}, "a=\"b c\""},
      {"=x", {"=x"}, "=x =x"},
      {"x", {"a b "}, "x a b "},
      {"-v foo=1", {"foo=2 bar=3 -v", "baz=4 bar=5"}, "-v foo=1 bar=3 baz=4"},
  };
  for (const Row &row : rows) {
    for (bool indexed : {false, true}) {
      SCOPED_TRACE(std::string("base \"") + row.base + "\"" + (indexed ? ", indexed" : ""));
      std::vector<char> buffer(256, '\x55');
      std::strcpy(buffer.data(), row.base);
      char *end = buffer.data() + strlen(row.base);
      nimb::OptionKeyIndex index;
      nimb::OptionKeyIndexInit(&index, buffer.data(), buffer.size(), indexed ? 16 : 0x7FFFFFFF);
      ASSERT_EQ(index.slots != nullptr, indexed);
      for (const char *source : row.sources) {
        for (const auto &[word, key] : Split(source))
          end = nimb::AppendIndexedOption(&index, end, word.c_str(), key.size(), word.size());
      }
      nimb::OptionKeyIndexFree(&index);
      EXPECT_STREQ(buffer.data(), row.result);
      EXPECT_EQ(end, buffer.data() + strlen(row.result));
      // Nothing is written behind the terminator.
      EXPECT_EQ(end[1], '\x55');
    }
  }
}

// The last pair with the key in the option string, else the configuration
// dictionary's value, parsed from a document as the boot options do.
class OptionsConfigTest : public nimbtest::LoaderTest {};

TEST_F(OptionsConfigTest, TheOptionStringBeatsTheDictionaryKeyByKey) {
  const char *value = nullptr;
  UINT64 length = 0;
  EXPECT_EQ(nimb::GetOptionOrConfigValue("a=1", "Kernel", &value, &length), EFI_NOT_FOUND) << "no dictionary";
  EXPECT_EQ(nimb::GetConfigValue("Kernel"), nullptr);
  std::string document =
      "<plist><dict>"
      "<key>Kernel</key><string>nimb_other</string>"
      "<key>Empty</key><string></string>"
      "<key>Root UUID</key><integer>5</integer>"
      "<key>Sub</key><dict><key>Kernel</key><string>nested</string></dict>"
      "</dict></plist>";
  ASSERT_EQ(nimb::PlistParseDocument(document.data(), &nimb::gConfigDict), EFI_SUCCESS);
  // "OFFSET:VALUE", the offset where the value starts in the text;
  // "config:VALUE" from the dictionary (GetConfigValue agreeing); "none":
  // not found, the outs untouched.
  const std::array<const char *, 3> rows[] = {
      {" \t\r\n", "-v", "none"},
      {"-v", "-v", "2:"},
      {"-vx", "-v", "none"},
      {"-x -v", "-x", "2:"},
      {"a=\"b c\"", "a", "3:b c"},
      {"a=\"b c\" d=1", "d", "10:1"},
      {"\"a b\"=c", "a b", "6:c"},
      {"\"a\"x=1", "a", "4:"},  // the byte behind a quoted key is a separator
      {"a=\"b", "a", "3:b"},
      {"a=1 a=2", "a", "6:2"},
      {"a=b=c", "a", "2:b"},
      {"a=b=c", "", "4:c"},
      {"configure=1", "config", "none"},
      {"[=1", "{", "2:1"},
      {"a=\"-v b\"", "-v", "none"},
      {"a\tb\r\nc", "c", "6:"},
      {"", "Kernel", "config:nimb_other"},
      {"kernel=a", "Kernel", "7:a"},
      {"Kernels=a", "Kernel", "config:nimb_other"},
      {"", "kernel", "none"},  // the dictionary's keys match exactly
      {nullptr, "Kernel", "config:nimb_other"},
      {"", "Empty", "config:"},
      {"", "Root UUID", "none"},  // not a string
  };
  for (const auto &[text, key, expected] : rows) {
    value = nullptr;
    length = 12345;
    const EFI_STATUS status = nimb::GetOptionOrConfigValue(text, key, &value, &length);
    std::string found = status == EFI_NOT_FOUND && value == nullptr && length == 12345 ? "none" : "?";
    if (status == EFI_SUCCESS) {
      const char *config = nimb::GetConfigValue(key);
      const std::string got(value, length);
      const bool fromText = text != nullptr && value >= text && value <= text + strlen(text);
      found = (fromText                             ? std::to_string(value - text)
               : config != nullptr && got == config ? "config"
                                                    : "?") +
              ":" + got;
    }
    EXPECT_EQ(found, expected) << "text \"" << (text != nullptr ? text : "(null)") << "\" key \"" << key
                               << "\"";
  }
}

}  // namespace
