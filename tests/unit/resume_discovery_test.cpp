// Resume discovery over the host firmware: the NVRAM request and what is
// deleted on each way out, the partition search, the offset text and the
// header's checks.
#include <gtest/gtest.h>

#include <functional>
#include <vector>

#include "resume/discovery.h"
#include "resume_scene.h"

namespace {

using namespace nimb;
using nimbtest::HibernatedMachine;
using nimbtest::ResumeImageSpec;

// A scene that runs the discovery alone.
struct Scene : nimbtest::ResumeScene {
  // The header's offset as text; on the whole disk with `disk` set.
  std::u16string Offset(const char *prefix, bool disk = false) {
    uint64_t offset = image.extents[0].start + (disk ? HibernatedMachine::kPartitionStart * 512 : 0);
    char hex[32];
    std::snprintf(hex, sizeof(hex), "%s%llx", prefix, static_cast<unsigned long long>(offset));
    return std::u16string(hex, hex + std::strlen(hex));
  }
  // Runs the discovery as TryResume does; false when no request was seen.
  bool Discover(ResumeState *state) {
    bool accepted = false;
    fw.Call([&] {
      if (ResumeRequested())
        accepted = ResumeFindImage(state) != 0;
    });
    return accepted;
  }
};

std::vector<uint8_t> Key() {
  return std::vector<uint8_t>(16, 0x4B);
}

void Delete(Scene &scene, const CHAR16 *name) {
  scene.fw.RuntimeServices()->SetVariable(name, &gNimbVendorVariableGuid, 0, 0, nullptr);
}

void PutImagePath(Scene &scene, const std::vector<uint8_t> &bytes) {
  scene.fw.PutVariable(kResumeImageVariable, gNimbVendorVariableGuid, nimbtest::kResumeVariableAttributes,
                       bytes);
}

std::vector<uint8_t> ImagePath(Scene &scene, const std::u16string &offset) {
  return nimbtest::ResumeImageVariable(scene.fw.DevicePathOf(scene.machine.partition), offset);
}

TEST(ResumeDiscoveryTest, NvramAfterEachWayOut) {
  struct Case {
    const char *name;
    std::function<void(ResumeImageSpec &)> spec;
    std::function<void(Scene &)> after;  // changes to the machine once installed
    bool acpi;
    bool accepted;
    bool requested;  // boot-signature was there (and is gone)
    bool keyGone;
  };
  auto none = [](ResumeImageSpec &) {};
  auto nothing = [](Scene &) {};
  const Case cases[] = {
      {"no request", none, [](Scene &s) { Delete(s, kResumeSignatureVariable); }, true, false, false, false},
      {"safe mode", none, [](Scene &) { gBootFlags |= kBootSafeMode; }, true, false, false, false},
      {"accepted", none, nothing, true, true, true, true},
      {"offset with 0x", none, [](Scene &s) { PutImagePath(s, ImagePath(s, s.Offset("0x"))); }, true, true,
       true, true},
      {"no boot-image", none, [](Scene &s) { Delete(s, kResumeImageVariable); }, true, false, true, false},
      {"empty boot-image", none,
       [](Scene &s) {
         s.fw.PutVariable(kResumeImageVariable, gNimbVendorVariableGuid, nimbtest::kResumeVariableAttributes,
                          {});
       },
       true, false, true, false},
      {"hard-drive node of length 0", none,
       [](Scene &s) {
         std::vector<uint8_t> path = ImagePath(s, u"1000");
         path[2] = path[3] = 0;
         PutImagePath(s, path);
       },
       true, false, true, false},
      {"path running past the variable", none,
       [](Scene &s) {
         std::vector<uint8_t> path = ImagePath(s, u"1000");
         path.resize(path.size() - 6);  // the end node and part of the file node cut off
         PutImagePath(s, path);
       },
       true, false, true, false},
      {"no file-path node", none,
       [](Scene &s) {
         std::vector<uint8_t> path = ImagePath(s, u"1000");
         path.resize(42);
         path.insert(path.end(), {END_DEVICE_PATH_TYPE, END_ENTIRE_DEVICE_PATH_SUBTYPE, 4, 0});
         PutImagePath(s, path);
       },
       true, false, true, false},
      {"no such partition", none,
       [](Scene &s) {
         std::vector<uint8_t> path = ImagePath(s, u"1000");
         path[4] = 9;  // PartitionNumber
         PutImagePath(s, path);
       },
       true, false, true, false},
      {"no DiskIO on the partition", none,
       [](Scene &s) { s.fw.UninstallProtocol(s.machine.partition, gEfiDiskIoProtocolGuid); }, true, false,
       true, false},
      {"header beyond the partition", none, [](Scene &s) { PutImagePath(s, ImagePath(s, u"fffffffffff")); },
       true, false, true, true},
      {"offset overflowing 64 bits", none,
       [](Scene &s) { PutImagePath(s, ImagePath(s, u"123456789abcdef0123")); }, true, false, true, true},
      {"text that is no number", none, [](Scene &s) { PutImagePath(s, ImagePath(s, u"zz")); }, true, false,
       true, true},
      {"wrong magic", none,
       [](Scene &s) {
         (*s.machine.disk)[HibernatedMachine::kPartitionStart * 512 + s.image.extents[0].start + 0x4C] ^= 1;
       },
       true, false, true, true},
      {"another machine", [](ResumeImageSpec &spec) { spec.machineSignature = 0x4E494D43; }, nothing, true,
       false, true, true},
      {"upper half of the signature set", [](ResumeImageSpec &spec) { spec.machineSignature |= 1ull << 32; },
       nothing, true, false, true, true},
      {"another machine, no ACPI", [](ResumeImageSpec &spec) { spec.machineSignature = 0x4E494D43; }, nothing,
       false, true, true, true},
  };
  for (const Case &c : cases) {
    SCOPED_TRACE(c.name);
    Scene scene;
    ResumeImageSpec spec;
    c.spec(spec);
    scene.Install(spec, Key());
    if (c.acpi)
      scene.fw.InstallAcpi({});
    c.after(scene);
    ResumeState state = {};
    EXPECT_EQ(scene.Discover(&state), c.accepted);
    const bool safeMode = (gBootFlags & kBootSafeMode) != 0;  // nothing asked, nothing deleted
    EXPECT_EQ(scene.Has(kResumeSignatureVariable), safeMode);
    EXPECT_TRUE(scene.Has(kResumeImageVariable) ||
                std::string(c.name).find("boot-image") != std::string::npos);
    EXPECT_EQ(!scene.Has(kResumeKeyVariable), c.keyGone);
    if (!c.requested) {
      EXPECT_EQ(scene.fw.CallCount("GetVariable"), safeMode ? 0u : 1u);
      EXPECT_EQ(scene.fw.CallCount("ReadDisk") + scene.fw.CallCount("LocateHandleBuffer"), 0u);
    }
    if (c.accepted) {
      ASSERT_NE(state.poolHeader, nullptr);
      EXPECT_EQ(state.poolHeader->magic, kResumeMagic);
      ASSERT_NE(state.key, nullptr);
      EXPECT_EQ(state.keyLength, 16u);
      EXPECT_EQ(state.key[0], 0x4B);
    }
  }
}

TEST(ResumeDiscoveryTest, FacpOfRevision3WithoutTheWideAddressUsesTheNarrowOne) {
  for (bool sameMachine : {true, false}) {
    Scene scene;
    ResumeImageSpec spec;
    spec.machineSignature = sameMachine ? 0x4E494D42 : 0x1234;
    scene.Install(spec);
    hostfw::AcpiOptions options;
    options.facpRevision = 3;
    hostfw::AcpiTables tables = scene.fw.InstallAcpi(options);
    std::memset(reinterpret_cast<uint8_t *>(tables.facp) + 132, 0, 8);  // X_FIRMWARE_CTRL
    ResumeState state = {};
    EXPECT_EQ(scene.Discover(&state), sameMachine);
  }
}

// The partition is the first BlockIO handle, in the firmware's order, whose
// path's first hard-drive node has the same number, MBR type, signature type
// and signature as the one in `boot-image`.
TEST(ResumeDiscoveryTest, PartitionSearch) {
  EFI_GUID guid = EFI_GUID_VALUE(0x11223344, 0x5566, 0x7788, 0x99, 0xAA, 0xBB, 0xCC, 0xDD, 0xEE, 0xFF, 0x00);
  hostfw::HardDriveNode wanted = hostfw::HardDriveNode::Gpt(guid, 3);
  wanted.start = 2048;
  auto with = [&](std::function<void(hostfw::HardDriveNode &)> change) {
    hostfw::HardDriveNode node = wanted;
    change(node);
    return node;
  };
  const hostfw::HardDriveNode elsewhere = with([](auto &n) {
    n.start = 999;
    n.blocks = 7;
  });
  const hostfw::HardDriveNode number = with([](auto &n) { n.partition = 4; });
  const hostfw::HardDriveNode signature = with([](auto &n) { n.signature[15] ^= 1; });
  const hostfw::HardDriveNode mbrType = with([](auto &n) { n.format = 1; });
  const hostfw::HardDriveNode signatureType = with([](auto &n) { n.signatureType = 1; });
  const hostfw::HardDriveNode shortNode = with([](auto &n) { n.length = 40; });
  struct Case {
    const char *name;
    std::vector<std::vector<hostfw::HardDriveNode>> devices;  // hard-drive nodes of each handle's path
    int taken;                                                // index of the handle, or -1
  };
  const Case cases[] = {
      {"the one", {{wanted}}, 0},
      {"after another", {{number}, {wanted}}, 1},
      {"the first of two equal ones", {{wanted}, {wanted}}, 0},
      {"start and size are not compared", {{elsewhere}}, 0},
      {"only the first node counts", {{number, wanted}}, -1},
      {"number differs", {{number}}, -1},
      {"signature differs", {{signature}}, -1},
      {"MBR type differs", {{mbrType}}, -1},
      {"signature type differs", {{signatureType}}, -1},
      {"a node too short is passed over", {{shortNode}, {wanted}}, 1},
      {"no hard-drive node", {{}, {wanted}}, 1},
  };
  for (const Case &c : cases) {
    SCOPED_TRACE(c.name);
    Scene scene;
    scene.Install(ResumeImageSpec{});
    // boot-image names `wanted` and the header's place on the whole disk.
    std::vector<uint8_t> path;
    {
      hostfw::Firmware &fw = scene.fw;
      EFI_HANDLE probe = fw.AddBlockDevice(scene.machine.disk);
      fw.SetHardDrivePath(probe, {wanted});
      path = nimbtest::ResumeImageVariable(fw.DevicePathOf(probe), scene.Offset("", true));
      fw.UninstallProtocol(probe, gEfiBlockIoProtocolGuid);
    }
    PutImagePath(scene, path);
    // The installed devices answer no more; only the case's own ones do.
    scene.fw.UninstallProtocol(scene.machine.whole, gEfiBlockIoProtocolGuid);
    scene.fw.UninstallProtocol(scene.machine.partition, gEfiBlockIoProtocolGuid);
    std::vector<void *> diskIo;
    for (const auto &nodes : c.devices) {
      EFI_HANDLE device = scene.fw.AddBlockDevice(scene.machine.disk);
      scene.fw.SetHardDrivePath(device, nodes);
      void *interface = nullptr;
      scene.fw.BootServices()->HandleProtocol(device, &gEfiDiskIoProtocolGuid, &interface);
      diskIo.push_back(interface);
    }
    ResumeState state = {};
    EXPECT_EQ(scene.Discover(&state), c.taken >= 0);
    if (c.taken >= 0)
      EXPECT_EQ(static_cast<void *>(state.diskIo), diskIo[c.taken]);
    // The handle array went back: what is left is the variable's buffer, the
    // block of memory tags and, for an accepted image, the header.
    EXPECT_EQ(scene.fw.LivePoolBlocks(), c.taken >= 0 ? 3u : 2u);
  }
}

TEST(ResumeDiscoveryTest, AHandlePathWithANodeOfLengthZeroIsPassedOver) {
  Scene scene;
  scene.machine.Install(scene.fw, nimbtest::BuildResumeImage({}));
  std::vector<uint8_t> broken = {HARDWARE_DEVICE_PATH,           1, 0, 0, END_DEVICE_PATH_TYPE,
                                 END_ENTIRE_DEVICE_PATH_SUBTYPE, 4, 0};
  scene.fw.SetDevicePath(scene.machine.whole, broken);
  ResumeState state = {};
  EXPECT_TRUE(scene.Discover(&state));
}

}  // namespace
