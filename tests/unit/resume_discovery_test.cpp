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
  Scene() : ResumeScene(false) {}
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
    fw.Call([&] { accepted = ResumeRequested() && ResumeFindImage(state); });
    return accepted;
  }
  void Delete(const CHAR16 *name) {
    fw.RuntimeServices()->SetVariable(name, &gNimbVendorVariableGuid, 0, 0, nullptr);
  }
  void PutPath(const std::vector<uint8_t> &bytes) {
    fw.PutVariable(kResumeImageVariable, gNimbVendorVariableGuid, nimbtest::kResumeVariableAttributes, bytes);
  }
  std::vector<uint8_t> Path(const std::u16string &offset) {
    return nimbtest::ResumeImageVariable(fw.DevicePathOf(machine.partition), offset);
  }
  // The path to offset 0x1000, changed by `change`.
  void PutChangedPath(std::function<void(std::vector<uint8_t> &)> change) {
    std::vector<uint8_t> path = Path(u"1000");
    change(path);
    PutPath(path);
  }
};

TEST(ResumeDiscoveryTest, NvramAfterEachWayOut) {
  struct Case {
    const char *name;
    std::function<void(ResumeImageSpec &)> spec;
    std::function<void(Scene &)> after;  // changes to the machine once installed
    bool accepted, requested, keyGone;   // requested: boot-signature was there (and is gone)
    bool acpi = true;
  };
  auto none = [](ResumeImageSpec &) {};
  auto nothing = [](Scene &) {};
  auto facpRevision3 = [](Scene &s) {
    hostfw::AcpiOptions options;
    options.facpRevision = 3;
    std::memset(reinterpret_cast<uint8_t *>(s.fw.InstallAcpi(options).facp) + 132, 0, 8);  // X_FIRMWARE_CTRL
  };
  const Case cases[] = {
      {"no request", none, [](Scene &s) { s.Delete(kResumeSignatureVariable); }, false, false, false},
      {"safe mode", none, [](Scene &) { gBootFlags |= kBootSafeMode; }, false, false, false},
      {"accepted", none, nothing, true, true, true},
      {"offset with 0x", none, [](Scene &s) { s.PutPath(s.Path(s.Offset("0x"))); }, true, true, true},
      {"no boot-image", none, [](Scene &s) { s.Delete(kResumeImageVariable); }, false, true, false},
      {"empty boot-image", none, [](Scene &s) { s.PutPath({}); }, false, true, false},
      {"hard-drive node of length 0", none,
       [](Scene &s) { s.PutChangedPath([](auto &p) { p[2] = p[3] = 0; }); }, false, true, false},
      {"path running past the variable", none,
       [](Scene &s) { s.PutChangedPath([](auto &p) { p.resize(p.size() - 6); }); }, false, true, false},
      {"no file-path node", none,
       [](Scene &s) {
         s.PutChangedPath([](auto &p) {
           p.resize(42);
           p.insert(p.end(), {END_DEVICE_PATH_TYPE, END_ENTIRE_DEVICE_PATH_SUBTYPE, 4, 0});
         });
       },
       false, true, false},
      {"no such partition", none, [](Scene &s) { s.PutChangedPath([](auto &p) { p[4] = 9; }); }, false, true,
       false},
      {"no DiskIO on the partition", none,
       [](Scene &s) { s.fw.UninstallProtocol(s.machine.partition, gEfiDiskIoProtocolGuid); }, false, true,
       false},
      {"a handle path with a node of length 0", none,
       [](Scene &s) {
         s.fw.SetDevicePath(s.machine.whole, {HARDWARE_DEVICE_PATH, 1, 0, 0, END_DEVICE_PATH_TYPE,
                                              END_ENTIRE_DEVICE_PATH_SUBTYPE, 4, 0});
       },
       true, true, true},
      {"header beyond the partition", none, [](Scene &s) { s.PutPath(s.Path(u"fffffffffff")); }, false, true,
       true},
      {"offset overflowing 64 bits", none, [](Scene &s) { s.PutPath(s.Path(u"123456789abcdef0123")); }, false,
       true, true},
      {"text that is no number", none, [](Scene &s) { s.PutPath(s.Path(u"zz")); }, false, true, true},
      {"wrong magic", none,
       [](Scene &s) {
         (*s.machine.disk)[HibernatedMachine::kPartitionStart * 512 + s.image.extents[0].start + 0x4C] ^= 1;
       },
       false, true, true},
      {"another machine", [](auto &spec) { spec.machineSignature = 0x4E494D43; }, nothing, false, true, true},
      {"upper half of the signature set", [](auto &spec) { spec.machineSignature |= 1ull << 32; }, nothing,
       false, true, true},
      {"another machine, no ACPI", [](auto &spec) { spec.machineSignature = 0x4E494D43; }, nothing, true,
       true, true, false},
      {"FACP revision 3 without the wide FACS address", none, facpRevision3, true, true, true, false},
      {"another machine, FACP revision 3", [](auto &spec) { spec.machineSignature = 0x1234; }, facpRevision3,
       false, true, true, false},
  };
  for (const Case &c : cases) {
    SCOPED_TRACE(c.name);
    Scene scene;
    ResumeImageSpec spec;
    c.spec(spec);
    scene.Install(spec);
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
      EXPECT_EQ(std::vector<UINT8>(state.key, state.key + state.keyLength), std::vector<UINT8>(16, 0x4B));
    }
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
  const hostfw::HardDriveNode elsewhere = with([](auto &n) { n.start = 999, n.blocks = 7; });
  const hostfw::HardDriveNode number = with([](auto &n) { n.partition = 4; });
  const struct {
    const char *name;
    std::vector<std::vector<hostfw::HardDriveNode>> devices;  // hard-drive nodes of each handle's path
    int taken;                                                // index of the handle, or -1
  } cases[] = {
      {"the one", {{wanted}}, 0},
      {"after another", {{number}, {wanted}}, 1},
      {"the first of two equal ones", {{wanted}, {wanted}}, 0},
      {"start and size are not compared", {{elsewhere}}, 0},
      {"only the first node counts", {{number, wanted}}, -1},
      {"number differs", {{number}}, -1},
      {"signature differs", {{with([](auto &n) { n.signature[15] ^= 1; })}}, -1},
      {"MBR type differs", {{with([](auto &n) { n.format = 1; })}}, -1},
      {"signature type differs", {{with([](auto &n) { n.signatureType = 1; })}}, -1},
      {"a node too short is passed over", {{with([](auto &n) { n.length = 40; })}, {wanted}}, 1},
      {"no hard-drive node", {{}, {wanted}}, 1},
  };
  for (const auto &c : cases) {
    SCOPED_TRACE(c.name);
    Scene scene;
    scene.Install(ResumeImageSpec{}, {});
    // boot-image names `wanted` and the header's place on the whole disk.
    EFI_HANDLE probe = scene.fw.AddBlockDevice(scene.machine.disk);
    scene.fw.SetHardDrivePath(probe, {wanted});
    scene.PutPath(nimbtest::ResumeImageVariable(scene.fw.DevicePathOf(probe), scene.Offset("", true)));
    // The installed devices answer no more; only the case's own ones do.
    for (EFI_HANDLE handle : {probe, scene.machine.whole, scene.machine.partition})
      scene.fw.UninstallProtocol(handle, gEfiBlockIoProtocolGuid);
    std::vector<void *> diskIo;
    for (const auto &nodes : c.devices) {
      EFI_HANDLE device = scene.fw.AddBlockDevice(scene.machine.disk);
      scene.fw.SetHardDrivePath(device, nodes);
      diskIo.push_back(nullptr);
      scene.fw.BootServices()->HandleProtocol(device, &gEfiDiskIoProtocolGuid, &diskIo.back());
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

}  // namespace
