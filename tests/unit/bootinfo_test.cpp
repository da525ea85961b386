// The boot record and the first properties of the tree.
#include "boot/bootinfo.h"

#include <gtest/gtest.h>

#include <cstring>
#include <functional>
#include <string>
#include <vector>

#include "devicetree/devicetree.h"
#include "loader_fixture.h"
#include "memory/kernel_region.h"
#include "support/devicepath.h"

namespace {

using namespace nimb;

class BootInfoTest : public nimbtest::VolumeTest {
 protected:
  void SetUp() override {
    VolumeTest::SetUp();
    ASSERT_NE(DeviceTreeInit(), nullptr);
    // As if a kernel lay at 0x200000..0x205000.
    gKernelRegionBase = 0x200000;
    gKernelRegionTop = 0x205000;
    gKernelName = u"a\\b";
  }
  // Parses a configuration dictionary into gConfigDict.
  void Config(const std::string &entries) {
    text_ = "<plist><dict>" + entries + "</dict></plist>";
    ASSERT_EQ(PlistParseDocument(text_.data(), &gConfigDict), EFI_SUCCESS);
  }
  // Runs InitBootInfo; what it prints lands in printed_.
  hostfw::RunResult Init(const char *options) {
    size_t before = fw.ConOutText().size();
    hostfw::RunResult result = fw.Call([&] { EXPECT_EQ(InitBootInfo(gLoadedImage, options), EFI_SUCCESS); });
    printed_ = fw.ConOutText().substr(before);
    return result;
  }
  static std::string Property(const char *path, const char *name, bool *present = nullptr) {
    DeviceTreeNode *node = DeviceTreeFindNode(path, 0);
    DeviceTreeProperty *property = node != nullptr ? DeviceTreeFindProperty(node, name) : nullptr;
    if (present != nullptr)
      *present = property != nullptr;
    if (property == nullptr)
      return "";
    return std::string(static_cast<const char *>(property->value), property->length);
  }

  std::string text_;
  std::string printed_;
};

TEST_F(BootInfoTest, TheRecordSitsAtTheTopOfTheKernelRegion) {
  ASSERT_EQ(Init("").end, hostfw::RunEnd::Returned);
  ASSERT_NE(bootArgs, nullptr);
  EXPECT_EQ(reinterpret_cast<UINT64>(bootArgs), 0x205000u);
  EXPECT_EQ(gKernelRegionTop, 0x206000u);
  // Everything else is zero until its writer has run (the page came with junk).
  BootArgs expected = {};
  expected.revision = 4;
  expected.version = 1;
  expected.firmwareBits = 0x40;
  EXPECT_EQ(memcmp(bootArgs, &expected, sizeof(BootArgs)), 0);

  EXPECT_EQ(Property("/", "compatible"), std::string("ACPI", 5));
  EXPECT_EQ(Property("/", "model"), std::string("ACPI", 5));
  EXPECT_EQ(Property("/chosen", "boot-file"), std::string("a\\b", 4));
  std::string path = Property("/chosen", "boot-device-path");
  EXPECT_EQ(path.size(), DevicePathSize(gBootDevicePath));
  EXPECT_EQ(memcmp(path.data(), gBootDevicePath, path.size()), 0);
  EXPECT_NE(gMemoryMapNode, nullptr);
  EXPECT_EQ(gMemoryMapNode, DeviceTreeFindNode("/chosen/memory-map", 0));
  EXPECT_EQ(gMemoryMapNode->properties->next, nullptr);  // only its name
}

TEST_F(BootInfoTest, RootIdentity) {
  struct Row {
    const char *name;
    const char *options;
    const char *config;  // entries of the configuration dictionary, or null
    bool present;
    std::string value;
    const char *printed;
  } rows[] = {
      {"rd", "rd", "<key>Root UUID</key><string>X</string>", false, "", ""},
      {"RD=x", "RD=x", nullptr, false, "", ""},
      {"configuration text as it stands", "", "<key>Root UUID</key><string>not a uuid</string>", true,
       std::string("not a uuid", 11), "\r\nroot device uuid is 'not a uuid'\r\n"},
      {"empty configuration text", "", "<key>Root UUID</key><string></string>", true, std::string(1, '\0'),
       "\r\nroot device uuid is ''\r\n"},
      {"a volume without identity", "", nullptr, false, "", "(no root UUID found for boot device)\r\n"},
      {"a non-string value", "", "<key>Root UUID</key><integer>1</integer>", false, "",
       "(no root UUID found for boot device)\r\n"},
  };
  for (const Row &row : rows) {
    TearDown();
    SetUp();
    if (row.config != nullptr)
      Config(row.config);
    // A device with a path but no partition node and no disk behind it.
    EFI_HANDLE anonymous = fw.NewHandle();
    fw.SetDevicePath(anonymous, {1, 1, 6, 0, 0, 2, 0x7F, 0xFF, 4, 0});
    fw.LoadedImage()->DeviceHandle = anonymous;
    ASSERT_EQ(Init(row.options).end, hostfw::RunEnd::Returned) << row.name;
    bool present = false;
    EXPECT_EQ(Property("/chosen", "boot-uuid", &present), row.value) << row.name;
    EXPECT_EQ(present, row.present) << row.name;
    EXPECT_EQ(printed_, row.printed) << row.name;
  }
}

TEST_F(BootInfoTest, FatalConditions) {
  struct Row {
    const char *message;
    std::function<void(hostfw::Firmware &)> arrange;
  } rows[] = {
      {"Couldn't allocate bootArgs\r\n", [](hostfw::Firmware &f) { f.FailCall("AllocatePages"); }},
      {"Couldn't create root node", [](hostfw::Firmware &) { DeviceTreeFree(); }},
      {"allocate kernel name", [](hostfw::Firmware &) { gKernelName = nullptr; }},
  };
  for (const Row &row : rows) {
    TearDown();
    SetUp();
    row.arrange(fw);
    hostfw::RunResult result = Init("rd");
    EXPECT_EQ(result.end, hostfw::RunEnd::Exited) << row.message;
    EXPECT_EQ(result.status, EFI_ABORTED) << row.message;
    const std::string &text = printed_;
    ASSERT_GE(text.size(), strlen(row.message));
    EXPECT_EQ(text.substr(text.size() - strlen(row.message)), row.message);
    Attach();
  }
}

}  // namespace
