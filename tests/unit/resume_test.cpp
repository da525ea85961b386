// The resume from an accepted header to the restart code, over the host
// firmware: the walk over the extents, every limit of the header, the
// decryption, and the restart with its record for the restart code.
#include <gtest/gtest.h>

#include <functional>
#include <vector>

#include "resume/preview_encoder.h"
#include "resume_scene.h"
#include "screen/resume_display.h"

namespace {

using namespace nimb;
using nimbtest::HibernatedMachine;
using nimbtest::ResumeImage;
using nimbtest::ResumeImageSpec;

// DiskIO of the partition with the size of every read recorded.
struct ReadRecorder {
  EFI_DISK_IO_PROTOCOL protocol;
  EFI_DISK_IO_PROTOCOL *inner;
  std::vector<UINTN> reads;
};
ReadRecorder *gRecorder;

EFI_STATUS EFIAPI RecordedRead(EFI_DISK_IO_PROTOCOL *, UINT32 mediaId, UINT64 offset, UINTN size,
                               VOID *buffer) {
  gRecorder->reads.push_back(size);
  return gRecorder->inner->ReadDisk(gRecorder->inner, mediaId, offset, size, buffer);
}

void RecordReads(nimbtest::ResumeScene &scene, ReadRecorder *recorder) {
  void *inner = nullptr;
  scene.fw.BootServices()->HandleProtocol(scene.machine.partition, &gEfiDiskIoProtocolGuid, &inner);
  recorder->inner = static_cast<EFI_DISK_IO_PROTOCOL *>(inner);
  recorder->protocol = *recorder->inner;
  recorder->protocol.ReadDisk = RecordedRead;
  gRecorder = recorder;
  scene.fw.UninstallProtocol(scene.machine.partition, gEfiDiskIoProtocolGuid);
  scene.fw.InstallProtocol(scene.machine.partition, gEfiDiskIoProtocolGuid, &recorder->protocol);
}

hostfw::RunResult Resume(nimbtest::ResumeScene &scene, bool console = false) {
  return scene.fw.Call([console] {
    if (console)
      ASSERT_EQ(InitConsole(), EFI_SUCCESS);
    TryResume();
  });
}

constexpr UINT32 kWidth = 320, kHeight = 200;

TEST(ResumeRunTest, RestartsTheImage) {
  nimbtest::ResumeScene scene;
  const ResumeImageSpec spec = nimbtest::ThreePageSpec();
  scene.Install(spec);
  const ResumeImage &image = scene.image;
  // Flash behind the runtime regions, as firmware maps it for its variables:
  // it takes address space past the runtime area, but nothing is copied.
  scene.fw.AddMemoryRegion(EfiMemoryMappedIO, 0xFFC00000, 0x400, EFI_MEMORY_RUNTIME | EFI_MEMORY_UC);
  scene.fw.GuardFreeMemory();
  hostfw::RunResult result = Resume(scene);

  ASSERT_EQ(result.end, hostfw::RunEnd::KernelEntered);
  EXPECT_TRUE(result.interruptsDisabled);
  EXPECT_EQ(result.gateAddress, 0x7000u);
  EXPECT_EQ(result.gateTarget, spec.restorePage * 4096ull + spec.restoreEntryOffset);
  EXPECT_TRUE(scene.fw.ViolationsAfterExit().empty());
  EXPECT_TRUE(scene.fw.VirtualMapSet());

  // The header and the first stage, read through the extents in list order.
  const UINT8 *header = reinterpret_cast<const UINT8 *>(result.gateArgument);
  ASSERT_EQ(result.gateArgument % 4096, 0u);
  ASSERT_LT(result.gateArgument, 1ull << 32);
  const ResumeHeader &h = *reinterpret_cast<const ResumeHeader *>(header);
  EXPECT_EQ(std::memcmp(header + 512, image.bytes.data() + 512, image.bytes.size() - 512), 0);
  EXPECT_EQ(std::memcmp(h.reservedA8, scene.image.Header().reservedA8, sizeof(h.reservedA8)), 0);

  // The restart code at its home, summed.
  const size_t code = scene.image.RestartCodeOffset();
  const std::vector<uint8_t> restartCode(image.bytes.begin() + code, image.bytes.begin() + code + 3 * 4096);
  EXPECT_EQ(std::memcmp(reinterpret_cast<const void *>(uintptr_t(spec.restorePage) * 4096),
                        restartCode.data(), restartCode.size()),
            0);
  EXPECT_EQ(h.restoreSum, nimbtest::PageSums(restartCode));

  // The scratch area in front of the header: the video record, a chain
  // block of zeros, and the runtime map with only runtime descriptors, the
  // copied ones inside the image's area.
  const UINT8 *scratch = header - h.videoDelta;
  EXPECT_EQ(std::vector<UINT32>({h.chainBlockDelta, h.memoryMapDelta}),
            std::vector<UINT32>({h.videoDelta - 772, h.videoDelta - 788}));
  const ResumeVideoRecord &video = *reinterpret_cast<const ResumeVideoRecord *>(scratch);
  EXPECT_EQ(std::vector<UINT64>({video.displayMode, video.baseAddress}), std::vector<UINT64>({1, 0}));
  EXPECT_EQ(std::vector<UINT8>(scratch + kResumeChainBlockOffset, scratch + kResumeChainBlockOffset + 16),
            std::vector<UINT8>(16, 0));
  const UINT64 area = spec.runtimePage * 4096ull;
  ASSERT_TRUE(h.memoryMapBytes > 0 && h.memoryMapBytes % hostfw::kDescriptorSize == 0);
  for (UINT32 at = 0; at < h.memoryMapBytes; at += hostfw::kDescriptorSize) {
    EFI_MEMORY_DESCRIPTOR d;  // the map is only 4-byte aligned
    std::memcpy(&d, scratch + 788 + at, sizeof(d));
    EXPECT_NE(d.Attribute & EFI_MEMORY_RUNTIME, 0u);
    if (d.Type != EfiMemoryMappedIO)
      EXPECT_TRUE(d.PhysicalStart >= area &&
                  d.PhysicalStart + d.NumberOfPages * 4096 <= area + spec.runtimePageCount * 4096ull);
  }
  EXPECT_EQ(reinterpret_cast<UINT64>(gST), area + h.systemTableOffset);
  EXPECT_EQ(gST->Hdr.Signature, EFI_SYSTEM_TABLE_SIGNATURE);
  EXPECT_FALSE(scene.Has(kResumeSignatureVariable));
  EXPECT_TRUE(scene.Has(kResumeImageVariable));
  EXPECT_FALSE(scene.Has(kResumeKeyVariable));
}

// The reads behind the header: without a preview one step of the bar at most
// and none across an extent's end; with one, the preview stage in one read
// first. The header alone reads nothing behind it and enters all the same.
TEST(ResumeRunTest, ReadsBehindTheHeader) {
  const UINTN previewStage = 0x1E0 + 32 + 2 * 4096 + 0x28000 - 512;
  const struct {
    uint64_t firstStage;
    uint32_t pages, preview;
    std::vector<uint64_t> extents;
    std::vector<UINTN> first;  // the first reads behind the header
    UINTN step;                // no later read larger
  } rows[] = {
      {512, 0, 0, {512}, {}, 0},
      {0x60000, 2, 0, {0x30000, 0}, {100000, 0x30000 - 512 - 100000}, 100000},
      {0x60000, 2, 0x28000, {0x30000, 0}, {previewStage}, (1900000 - previewStage) / 19},
  };
  for (const auto &row : rows) {
    SCOPED_TRACE(row.preview);
    nimbtest::ResumeScene scene;
    ResumeImageSpec spec;
    spec.imageBytes = 1900000;
    spec.firstStageBytes = row.firstStage;
    spec.restorePageCount = row.pages;
    spec.previewBytes = row.preview;
    spec.extentLengths = row.extents;
    scene.Install(spec);
    ReadRecorder recorder = {};
    RecordReads(scene, &recorder);
    const hostfw::RunResult result = Resume(scene);
    ASSERT_EQ(result.end, hostfw::RunEnd::KernelEntered);
    if (row.pages == 0)
      EXPECT_EQ(reinterpret_cast<const ResumeHeader *>(result.gateArgument)->restoreSum, 0u);
    ASSERT_GE(recorder.reads.size(), 1 + row.first.size());
    EXPECT_EQ(recorder.reads[0], 512u);
    EXPECT_EQ(std::vector<UINTN>(recorder.reads.begin() + 1, recorder.reads.begin() + 1 + row.first.size()),
              row.first);
    UINT64 total = 0;
    for (size_t i = 1; i < recorder.reads.size(); i++) {
      EXPECT_LE(recorder.reads[i], i <= row.first.size() ? row.first[i - 1] : row.step);
      total += recorder.reads[i];
    }
    EXPECT_EQ(total, row.firstStage - 512);
  }
}

// Without a preview and with an image of 1900000 bytes, 250000 bytes read
// behind the header leave the bar at step 2: cells 0 and 1 finished, cell 2
// being worked on, the rest not reached.
TEST(ResumeRunTest, TheBarStandsAtTheStepOfTheBytesRead) {
  nimbtest::ResumeScene scene;
  scene.fw.AddScreen({kWidth, kHeight, 32});
  ResumeImageSpec spec;
  spec.imageBytes = 1900000;
  spec.firstStageBytes = 512 + 250000;
  spec.extentLengths = {0x10000, 0};
  scene.Install(spec);
  ASSERT_EQ(Resume(scene, true).end, hostfw::RunEnd::KernelEntered);
  const UINT32 left = (kWidth - 190) / 2, top = kHeight - 97;
  const UINT32 levels[] = {230, 230, 174, 92, 92};
  for (UINT32 cell = 0; cell < 5; cell++)  // a pixel of full alpha in each cell
    EXPECT_EQ(scene.fw.ScreenPixel(left + 10 * cell + 3, top + 5) & 0xFF, levels[cell]) << "cell " << cell;
}

TEST(ResumeRunTest, AFailedReadIsReportedAndResets) {
  nimbtest::ResumeScene scene;
  ResumeImageSpec spec;
  spec.imageBytes = 0x100000;  // reads of a whole extent
  ResumeImage image = nimbtest::BuildResumeImage(spec);
  scene.Install(image);
  // The second extent lies beyond the partition.
  image.extents[1].start = HibernatedMachine::kPartitionBlocks * 512;
  std::memcpy(
      scene.machine.disk->data() + HibernatedMachine::kPartitionStart * 512 + image.extents[0].start + 0x1F0,
      &image.extents[1], 16);
  EXPECT_EQ(Resume(scene).end, hostfw::RunEnd::Reset);
  EXPECT_EQ(scene.fw.ConOutText(), "!Read 800\r\n");
}

// Each key size; with 16 bytes a preview on a screen, encrypted from behind
// it; with the others no preview and all but the header encrypted, so that
// the restart code is copied as decrypted.
TEST(ResumeEncryptedTest, DecryptsInPlaceDrawsThePreviewAndLeavesNoKeyBehind) {
  for (size_t keySize : {16u, 24u, 32u}) {
    SCOPED_TRACE(keySize);
    const bool preview = keySize == 16;
    nimbtest::ResumeScene scene;
    scene.fw.AddScreen({kWidth, kHeight, 32});
    std::string error;
    const std::vector<uint8_t> picture = previewenc::EncodePreview(
        std::vector<uint32_t>(kWidth * kHeight, 0x00336699), kWidth, kHeight, 4, &error);
    ResumeImageSpec spec;
    spec.firstStageBytes = 0x8000;
    spec.imageBytes = 0x20000;
    if (preview) {
      spec.previewBytes = uint32_t(picture.size() + 8);
      spec.previewPictureOffset = 8;
    }
    ResumeImage image = nimbtest::BuildResumeImage(spec);
    const size_t code = image.RestartCodeOffset(), section = code + 2 * 4096;
    if (preview)
      std::copy(picture.begin(), picture.end(), image.bytes.begin() + section + 8);
    const size_t encrypted = (preview ? section + spec.previewBytes : code) + 15 & ~size_t(15);
    image.Header().encryptedOffset = encrypted;
    const std::vector<uint8_t> plain = image.bytes;
    std::vector<uint8_t> key(keySize);
    for (size_t i = 0; i < keySize; i++)
      key[i] = uint8_t(0xA0 + i);
    const std::vector<uint8_t> cipher = nimbtest::OpensslCbc(
        true, key, kResumeIv, std::vector<uint8_t>(plain.begin() + encrypted, plain.end()));
    std::copy(cipher.begin(), cipher.end(), image.bytes.begin() + encrypted);

    scene.Install(image, key);
    scene.fw.GuardFreeMemory();
    const hostfw::RunResult result = Resume(scene, true);
    ASSERT_EQ(result.end, hostfw::RunEnd::KernelEntered);
    const UINT8 *header = reinterpret_cast<const UINT8 *>(result.gateArgument);
    const ResumeHeader &h = *reinterpret_cast<const ResumeHeader *>(header);
    EXPECT_EQ(std::memcmp(header + 512, plain.data() + 512, plain.size() - 512), 0) << "decrypted in place";
    const UINT8 *scratch = header - h.videoDelta;
    EXPECT_EQ(std::memcmp(scratch + kResumeChainBlockOffset, cipher.data() + cipher.size() - 16, 16), 0);
    EXPECT_EQ(h.restoreSum, nimbtest::PageSums(
                                std::vector<uint8_t>(plain.begin() + code, plain.begin() + code + 2 * 4096)));
    const ResumeVideoRecord &video = *reinterpret_cast<const ResumeVideoRecord *>(scratch);
    EXPECT_EQ(std::vector<UINT64>({video.width, video.height, video.depth}),
              std::vector<UINT64>({kWidth, kHeight, 32}));
    EXPECT_NE(video.baseAddress, 0u);
    // The preview, or the logo, and the bar's samples saved.
    EXPECT_EQ(scene.fw.CallCount("UgaBlt") == 0, preview);
    const UINT8 *table = scratch + kResumeSaveTableOffset;
    EXPECT_TRUE(std::any_of(table, table + kProgressSaveTableBytes, [](UINT8 b) { return b != 0; }));
    EXPECT_FALSE(scene.Has(kResumeKeyVariable));
    // The key's bytes stand nowhere in the loader's pool any more.
    for (const MemoryTag *tag = gMemoryTags; tag != nullptr; tag = tag->next)
      EXPECT_FALSE(tag->poolAddress != nullptr && std::memcmp(tag->poolAddress, key.data(), 8) == 0);
  }
}

// Every limit the header must keep: broken, the machine resets before it
// leaves boot services, and nothing outside what the loader holds is
// touched (the free memory is guarded).
TEST(ResumeRunTest, AHeaderBreakingALimitResets) {
  using Spec = std::function<void(ResumeImageSpec &)>;
  using Change = std::function<void(ResumeImage &)>;
  const struct Case {
    const char *name;
    Spec spec;
    Change image = [](ResumeImage &) {};  // after the build; the list goes back into the bytes
    std::vector<uint8_t> key = std::vector<uint8_t>(16, 0x4B);
    std::function<void(hostfw::Firmware &)> fault;  // a Fatal before the key is taken
  } cases[] = {
      {"first stage below 512", [](auto &) {}, [](auto &i) { i.Header().firstStageBytes = 511; }},
      {"first stage of 4 GiB", [](auto &) {}, [](auto &i) { i.Header().firstStageBytes = 1ull << 32; }},
      {"image smaller than its first stage", [](auto &) {}, [](auto &i) { i.Header().imageBytes = 0x5FFF; }},
      {"restart code past the first stage", [](auto &s) { s.restorePageCount = 6; }},
      {"preview past the first stage", [](auto &s) { s.previewBytes = 0x5000; }},
      {"preview inside the header",
       [](auto &s) {
         s.restorePageCount = 0;
         s.previewBytes = 1;
         s.extentLengths = {0x6000};
       }},
      {"restart code's home across 4 GiB", [](auto &s) { s.restorePage = 0xFFFFF; }},
      {"runtime area across 4 GiB", [](auto &s) { s.runtimePage = 0xFFFF0, s.runtimePageCount = 0x20; }},
      {"restart code's home in use", [](auto &s) { s.restorePage = 0x3FFFF, s.restorePageCount = 1; }},
      {"runtime area too small", [](auto &s) { s.runtimePageCount = 5; }},
      {"no runtime area", [](auto &s) { s.runtimePageCount = 0; }},
      {"encrypted from past the first stage", [](auto &s) { s.encryptedOffset = 0x6000; }},
      {"encrypted part not whole blocks", [](auto &s) { s.encryptedOffset = 0x1008; }},
      {"encrypted header", [](auto &s) { s.encryptedOffset = 0x100; }},
      {"encrypted extent list", [](auto &s) { s.encryptedOffset = 0x200; }},
      {"encrypted without a key", [](auto &s) { s.encryptedOffset = 0x1000; }, [](auto &) {}, {}},
      {"encrypted with a key of 20 bytes", [](auto &s) { s.encryptedOffset = 0x1000; }, [](auto &) {},
       std::vector<uint8_t>(20, 0x4B)},
      {"first extent below 512",
       [](auto &s) {
         s.extentLengths = {0x100, 0x800, 0};
       },
       [](auto &i) { i.extents[1].start = i.extents[0].start + 0x100; }},
      {"extents short of the first stage", [](auto &) {}, [](auto &i) { i.extents[2].length -= 16; }},
      {"an entry not read yet",
       [](auto &s) {
         s.extentLengths = {512, 8, 0};
       }},
      {"an extent list of no entry", [](auto &s) { s.extentLengths = {0x6000}; },
       [](auto &i) { i.Header().extentBytes = 8; }},
      {"no pool for memory tags", [](auto &) {}, [](auto &) {}, std::vector<uint8_t>(16, 0x4B),
       [](hostfw::Firmware &f) { f.FailPoolAllocationOfSize(kMemoryTagBlockSize); }},
  };
  for (const Case &c : cases) {
    SCOPED_TRACE(c.name);
    nimbtest::ResumeScene scene;
    ResumeImageSpec spec;
    c.spec(spec);
    ResumeImage broken = nimbtest::BuildResumeImage(spec);
    c.image(broken);
    for (size_t i = 0; i < broken.extents.size() && 0x1E0 + 16 * i + 16 <= broken.bytes.size(); i++)
      std::memcpy(broken.bytes.data() + 0x1E0 + 16 * i, &broken.extents[i], 16);
    scene.Install(broken, c.key);
    scene.fw.GuardFreeMemory();
    if (c.fault)
      c.fault(scene.fw);
    const hostfw::RunResult result = Resume(scene);
    EXPECT_EQ(result.end, hostfw::RunEnd::Reset);
    EXPECT_EQ(result.resetType, EfiResetCold);
    EXPECT_FALSE(scene.fw.BootServicesExited());
    EXPECT_EQ(!scene.Has(kResumeKeyVariable), !c.fault);
    EXPECT_EQ(scene.fw.ConOutText(), c.fault ? "Can't allocate memory tag" : "");
    TrackedFreeAll();
    EXPECT_EQ(scene.fw.AllocatedPages(), 0u);
  }
}

}  // namespace
