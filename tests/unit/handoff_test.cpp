// The final hand-off over the host firmware, end to end: the tree's last
// properties, the flattened tree and the memory map in the kernel region,
// the end of boot services and the runtime move.
#include "boot/handoff.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <functional>
#include <map>
#include <string>
#include <vector>

#include "boot/bootinfo.h"
#include "devicetree/devicetree.h"
#include "devicetree/platform.h"
#include "efi/vendor.h"
#include "hostfw/network.h"
#include "loader_fixture.h"
#include "memory/kernel_region.h"

namespace {

using namespace nimb;

// The flattened tree read back: "path" -> property name -> values in order.
struct FlatTree {
  std::map<std::string, std::multimap<std::string, std::string>> nodes;
  std::vector<std::string> order;  // node paths in the order they stand
  bool ok = false;
};

bool ReadNode(const uint8_t *data, size_t size, size_t *at, const std::string &parent, FlatTree *tree) {
  uint32_t counts[2];  // properties, children
  if (*at + 8 > size)
    return false;
  memcpy(counts, data + *at, 8);
  *at += 8;
  std::multimap<std::string, std::string> props;
  uint32_t length = 0;
  for (uint32_t i = 0; i < counts[0]; i++, *at += 36 + ((length + 3) & ~3u)) {
    if (*at + 36 > size || (memcpy(&length, data + *at + 32, 4), *at + 36 + length > size))
      return false;
    const char *key = reinterpret_cast<const char *>(data + *at);
    props.emplace(std::string(key, strnlen(key, 32)), std::string(key + 36, length));
  }
  const std::string name = props.count("name") != 0 ? props.find("name")->second.c_str() : "";
  std::string path = parent.empty() ? "/" : (parent == "/" ? "/" + name : parent + "/" + name);
  tree->nodes[path] = props;
  tree->order.push_back(path);
  for (uint32_t i = 0; i < counts[1]; i++) {
    if (!ReadNode(data, size, at, path, tree))
      return false;
  }
  return true;
}

FlatTree ReadTree(const BootArgs *args) {
  FlatTree tree;
  size_t at = 0;
  const uint8_t *data = reinterpret_cast<const uint8_t *>(static_cast<uintptr_t>(args->deviceTree));
  tree.ok = ReadNode(data, args->deviceTreeLength, &at, "", &tree) && at == args->deviceTreeLength;
  return tree;
}

// Device properties of `blob`'s size; a firmware that never fills the buffer
// asks for that much more each time.
struct FakeDeviceProperties {
  NIMB_DEVICE_PROPERTIES_PROTOCOL protocol;
  std::vector<uint8_t> blob;
  bool fills;
  int calls;
};

EFI_STATUS EFIAPI GetDeviceProperties(NIMB_DEVICE_PROPERTIES_PROTOCOL *This, VOID *Buffer, UINT32 *Size) {
  auto *self = reinterpret_cast<FakeDeviceProperties *>(This);
  self->calls++;
  if (!self->fills || *Size < self->blob.size()) {
    *Size = static_cast<UINT32>(self->blob.size()) + (self->fills ? 0 : *Size);
    return EFI_BUFFER_TOO_SMALL;
  }
  memcpy(Buffer, self->blob.data(), self->blob.size());
  *Size = static_cast<UINT32>(self->blob.size());
  return EFI_SUCCESS;
}

class HandOffTest : public nimbtest::LoaderTest {
 protected:
  void SetUp() override {
    LoaderTest::SetUp();
    gLoadedImage = fw.LoadedImage();
    device_ = fw.NewHandle();
    fw.SetDevicePath(device_, {1, 1, 6, 0, 0, 2, 0x7F, 0xFF, 4, 0});
    fw.SetBootDevice(device_);
    gBootDevicePath = fw.DevicePathOf(device_);
    gKernelName = u"nimb_kernel";
  }
  // The boot as far as the hand-off: tree, a kernel at 0x200000, the record.
  void Prepare(const char *options = "-v a=1", const char *recordOptions = "rd") {
    options_ = options;
    ASSERT_EQ(fw.Call([&] {
                  InitPlatformDescription();
                  UINT64 address = 0x200000, size = 0x3000;
                  ASSERT_NE(AllocateKernelPages(&address, &size), 0u);
                  gKernelRegionBase = 0x200000;
                  gKernelRegionTop = 0x203000;
                  InitBootInfo(gLoadedImage, recordOptions);
                }).end,
              hostfw::RunEnd::Returned);
  }
  hostfw::RunResult Finish() {
    return fw.Call([&] { FinishBootInfo(&mapKey_, options_.c_str()); });
  }

  EFI_HANDLE device_ = nullptr;
  UINTN mapKey_ = 0;
  std::string options_;
};

TEST_F(HandOffTest, AnOrdinaryBootEndsWithTheKernelsRecordComplete) {
  Prepare();
  EFI_SYSTEM_TABLE *oldSystemTable = gST;
  ASSERT_EQ(Finish().end, hostfw::RunEnd::Returned);
  EXPECT_TRUE(fw.BootServicesExited());
  EXPECT_TRUE(fw.VirtualMapSet());
  EXPECT_TRUE(fw.ViolationsAfterExit().empty());
  EXPECT_EQ(gBS, nullptr);
  EXPECT_EQ(gRT, nullptr);
  EXPECT_NE(gST, oldSystemTable);
  EXPECT_EQ(gST->Hdr.Signature, EFI_SYSTEM_TABLE_SIGNATURE);

  EXPECT_STREQ(bootArgs->commandLine, "-v a=1");
  EXPECT_EQ(bootArgs->systemTable, static_cast<UINT32>(reinterpret_cast<UINT64>(gST)));
  EXPECT_EQ(bootArgs->memoryDescriptorSize, hostfw::kDescriptorSize);
  EXPECT_EQ(bootArgs->memoryDescriptorVersion, 1u);
  EXPECT_EQ(bootArgs->kernelRegionBase, 0x200000u);
  EXPECT_EQ(bootArgs->kernelRegionSize, gKernelRegionTop - gKernelRegionBase);
  EXPECT_EQ(gKernelRegionTop, (bootArgs->runtimePageStart + bootArgs->runtimePageCount) * EFI_PAGE_SIZE);
  // The record, the tree and the map lie in the region, the runtime area on top.
  EXPECT_GT(bootArgs->deviceTree, reinterpret_cast<UINT64>(bootArgs));
  EXPECT_GT(bootArgs->memoryMap, bootArgs->deviceTree);
  EXPECT_GE(bootArgs->runtimePageStart * EFI_PAGE_SIZE, bootArgs->memoryMap + bootArgs->memoryMapSize);

  // The map: runtime regions moved into the runtime area, their old places free.
  unsigned runtime = 0;
  const uint8_t *map = reinterpret_cast<const uint8_t *>(static_cast<uintptr_t>(bootArgs->memoryMap));
  for (UINT32 offset = 0; offset < bootArgs->memoryMapSize; offset += bootArgs->memoryDescriptorSize) {
    const auto *d = reinterpret_cast<const EFI_MEMORY_DESCRIPTOR *>(map + offset);
    if (d->Attribute & EFI_MEMORY_RUNTIME) {
      runtime++;
      EXPECT_GE(d->PhysicalStart, bootArgs->runtimePageStart * EFI_PAGE_SIZE);
      EXPECT_LE(d->PhysicalStart + d->NumberOfPages * EFI_PAGE_SIZE,
                (bootArgs->runtimePageStart + bootArgs->runtimePageCount - 2) * EFI_PAGE_SIZE);
    }
  }
  EXPECT_GE(runtime, 2u);

  FlatTree tree = ReadTree(bootArgs);
  ASSERT_TRUE(tree.ok);
  auto &chosen = tree.nodes["/chosen"];
  EXPECT_EQ(chosen.find("boot-args")->second, std::string("-v a=1", 7));
  EXPECT_EQ(tree.nodes["/efi"].find("firmware-abi")->second, std::string("EFI64", 6));
  EXPECT_EQ(tree.nodes["/efi"].find("firmware-revision")->second.size(), 4u);
  EXPECT_EQ(tree.nodes["/efi/runtime-services"].find("table")->second.size(), 8u);
  EXPECT_EQ(tree.nodes["/"].count("net-boot"), 0u);
  EXPECT_EQ(tree.nodes["/chosen/memory-map"].count("BootCLUT"), 1u);
  EXPECT_EQ(tree.nodes["/chosen/memory-map"].count("Pict-FailedBoot"), 1u);
  // The root's children flatten as chosen, then efi; those of /efi as
  // runtime-services, configuration-table, platform.
  std::vector<std::string> top;
  for (const std::string &path : tree.order) {
    if (path == "/chosen" || path == "/efi" || path == "/efi/runtime-services" ||
        path == "/efi/configuration-table" || path == "/efi/platform")
      top.push_back(path);
  }
  EXPECT_EQ(top, (std::vector<std::string>{"/chosen", "/efi", "/efi/runtime-services",
                                           "/efi/configuration-table", "/efi/platform"}));
}

// Each case ends boot services, so each gets a firmware of its own.
class CommandLineTest : public HandOffTest,
                        public ::testing::WithParamInterface<std::pair<size_t, size_t>> {};

TEST_P(CommandLineTest, IsCutTo1023Bytes) {
  auto [length, kept] = GetParam();
  Prepare(std::string(length, 'x').c_str());
  ASSERT_EQ(Finish().end, hostfw::RunEnd::Returned);
  EXPECT_EQ(strlen(bootArgs->commandLine), kept);
  FlatTree tree = ReadTree(bootArgs);
  EXPECT_EQ(tree.nodes["/chosen"].find("boot-args")->second.size(), kept + 1);
}

INSTANTIATE_TEST_SUITE_P(Lengths, CommandLineTest,
                         ::testing::Values(std::make_pair(1023, 1023), std::make_pair(1024, 1023),
                                           std::make_pair(3000, 1023), std::make_pair(0, 0)));

class NetworkIdentityTest : public HandOffTest,
                            public ::testing::WithParamInterface<std::pair<int, size_t>> {};

TEST_P(NetworkIdentityTest, DigitsByInterfaceType) {
  auto [interfaceType, digits] = GetParam();
  hostfw::NetworkDevice net(fw, true, static_cast<uint8_t>(interfaceType));
  fw.SetBootDevice(net.Handle());
  gBootDevicePath = fw.DevicePathOf(net.Handle());
  Prepare();
  ASSERT_EQ(Finish().end, hostfw::RunEnd::Returned);
  FlatTree tree = ReadTree(bootArgs);
  ASSERT_EQ(tree.nodes["/chosen"].count("root-matching"), 1u);
  std::string matching = tree.nodes["/chosen"].find("root-matching")->second;
  std::string head = kRootMatchingHead;
  ASSERT_EQ(matching.substr(0, head.size()), head);
  EXPECT_EQ(matching.substr(head.size(), 12), "525400123456");
  EXPECT_EQ(matching.substr(head.size() + digits), std::string(kRootMatchingTail) + '\0');
  EXPECT_EQ(tree.nodes["/"].count("net-boot"), 1u);
}

INSTANTIATE_TEST_SUITE_P(Types, NetworkIdentityTest,
                         ::testing::Values(std::make_pair(0, 12), std::make_pair(1, 12),
                                           std::make_pair(2, 64), std::make_pair(6, 64)));

// Larger than the first buffer: read in a second call. Never filled: left
// out, after more than one call.
class DevicePropertiesTest : public HandOffTest,
                             public ::testing::WithParamInterface<std::pair<size_t, bool>> {};

TEST_P(DevicePropertiesTest, AreReadWhole) {
  auto [size, fills] = GetParam();
  FakeDeviceProperties properties = {{{}, GetDeviceProperties}, std::vector<uint8_t>(size), fills, 0};
  for (size_t i = 0; i < size; i++)
    properties.blob[i] = static_cast<uint8_t>(i);
  fw.InstallProtocol(fw.NewHandle(), gNimbDevicePropertiesProtocolGuid, &properties);
  Prepare();
  ASSERT_EQ(Finish().end, hostfw::RunEnd::Returned);
  FlatTree tree = ReadTree(bootArgs);
  auto &efi = tree.nodes["/efi"];
  EXPECT_EQ(efi.count("device-properties"), fills ? 1u : 0u);
  if (fills) {
    EXPECT_EQ(properties.calls, 2);
    EXPECT_EQ(efi.find("device-properties")->second,
              std::string(properties.blob.begin(), properties.blob.end()));
  } else {
    EXPECT_GT(properties.calls, 1);
  }
}

INSTANTIATE_TEST_SUITE_P(Sizes, DevicePropertiesTest,
                         ::testing::Values(std::make_pair(6000, true), std::make_pair(0, false),
                                           std::make_pair(100, false)));

// Whatever the final read finds, the descriptors that the runtime move
// appends stay inside the map's own pages, which are extended in place: the
// sweep of growths (the final loop's probe is the third call) crosses the
// point where the map alone still fits and the appended ones would not.
class MapGrowthTest : public HandOffTest, public ::testing::WithParamInterface<unsigned> {};

// Odd parameters grow the map by runtime regions, each of which needs a
// descriptor more behind the map when it is moved.
TEST_P(MapGrowthTest, TheRoomForTheMovedRegionsSurvives) {
  const unsigned grow = GetParam();
  Prepare("", "");
  fw.GrowMemoryMapOnCall(3, grow, grow % 2 == 1);
  ASSERT_EQ(Finish().end, hostfw::RunEnd::Returned);
  ASSERT_LE(bootArgs->memoryMap + bootArgs->memoryMapSize, bootArgs->runtimePageStart * EFI_PAGE_SIZE);
  EXPECT_GT(bootArgs->memoryMap, bootArgs->deviceTree);
  EXPECT_GT(bootArgs->memoryMapSize, grow * hostfw::kDescriptorSize);
  const uint8_t *map = reinterpret_cast<const uint8_t *>(static_cast<uintptr_t>(bootArgs->memoryMap));
  const auto *last = reinterpret_cast<const EFI_MEMORY_DESCRIPTOR *>(map + bootArgs->memoryMapSize -
                                                                     bootArgs->memoryDescriptorSize);
  EXPECT_NE(last->Attribute & EFI_MEMORY_RUNTIME, 0u);
}

INSTANTIATE_TEST_SUITE_P(Sweep, MapGrowthTest, ::testing::Range(0u, 100u));
INSTANTIATE_TEST_SUITE_P(Large, MapGrowthTest, ::testing::Values(200u));

// The runtime move needs free memory above the kernel region; what stands
// there ends the boot while the console can still say so.
TEST_F(HandOffTest, ARuntimeAreaOverUsedMemoryIsFatal) {
  fw.AddMemoryRegion(EfiRuntimeServicesData, 0x30000000, 0x100, EFI_MEMORY_RUNTIME);
  fw.AddMemoryRegion(EfiACPIMemoryNVS, 0x280000, 1, 0);
  Prepare();
  hostfw::RunResult result = Finish();
  EXPECT_EQ(result.end, hostfw::RunEnd::Exited);
  EXPECT_EQ(result.status, EFI_ABORTED);
  EXPECT_FALSE(fw.BootServicesExited());
  const std::string text = fw.ConOutText();
  EXPECT_EQ(text.substr(text.rfind("Runtime")), "Runtime services area not free\r\n");
}

// Boot options that could not be settled leave no option string: the record
// and the hand-off take it for an empty one.
TEST_F(HandOffTest, NoOptionStringIsAnEmptyOne) {
  Prepare("", nullptr);
  ASSERT_EQ(fw.Call([&] { FinishBootInfo(&mapKey_, nullptr); }).end, hostfw::RunEnd::Returned);
  EXPECT_STREQ(bootArgs->commandLine, "");
  EXPECT_EQ(ReadTree(bootArgs).nodes["/chosen"].find("boot-args")->second, std::string(1, '\0'));
}

TEST_F(HandOffTest, BothAcpiTablesAndTheMachineSignature) {
  hostfw::AcpiOptions options;
  options.configurationGuids = {gEfiAcpi10TableGuid, gEfiAcpi20TableGuid};
  options.hardwareSignature = 0x12345678;
  hostfw::AcpiTables tables = fw.InstallAcpi(options);
  Prepare();
  ASSERT_EQ(Finish().end, hostfw::RunEnd::Returned);
  FlatTree tree = ReadTree(bootArgs);
  std::vector<std::string> aliases;
  for (const auto &[path, properties] : tree.nodes) {
    if (path.rfind("/efi/configuration-table/", 0) != 0)
      continue;
    auto alias = properties.find("alias");
    if (alias == properties.end())
      continue;
    aliases.push_back(alias->second);
    // The child is named by its GUID, and "table" is the firmware's pointer.
    uint64_t table = 0;
    memcpy(&table, properties.find("table")->second.data(), 8);
    EXPECT_EQ(table, tables.rsdp) << path;
  }
  std::sort(aliases.begin(), aliases.end());
  EXPECT_EQ(aliases, (std::vector<std::string>{std::string("ACPI", 5), std::string("ACPI_20", 8)}));
  EXPECT_EQ(tree.nodes["/efi/configuration-table/8868E871-E4F1-11D3-BC22-0080C73C8881"].count("guid"), 1u);
  std::string signature = tree.nodes["/chosen"].find("machine-signature")->second;
  EXPECT_EQ(signature, std::string("\x78\x56\x34\x12", 4));
}

class MapReadTest : public HandOffTest, public ::testing::WithParamInterface<unsigned> {};

TEST_P(MapReadTest, FourFailingReadsOfTheFinalMapEndTheRun) {
  unsigned failures = GetParam();
  Prepare();
  // The first look is a probe and a read; the final loop probes and reads
  // again each time: its reads are the 4th, 6th, 8th and 10th calls.
  for (unsigned i = 0; i < failures; i++)
    fw.FailCall("GetMemoryMap", 4 + 2 * i, EFI_DEVICE_ERROR);
  size_t before = fw.ConOutText().size();
  hostfw::RunResult result = Finish();
  if (failures < 4) {
    EXPECT_EQ(result.end, hostfw::RunEnd::Returned);
    EXPECT_TRUE(fw.BootServicesExited());
  } else {
    EXPECT_EQ(result.end, hostfw::RunEnd::Exited);
    EXPECT_EQ(result.status, EFI_ABORTED);
    EXPECT_FALSE(fw.BootServicesExited());
    EXPECT_EQ(fw.ConOutText().substr(before), "Can't get current memory map (5, 8000000000000007)\r\n");
  }
}

INSTANTIATE_TEST_SUITE_P(Failures, MapReadTest, ::testing::Values(3u, 4u));

}  // namespace
