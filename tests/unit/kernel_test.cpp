// Loading the kernel image: finding the x86 slice of a fat file, placing the
// segments of a kernel object, refusing objects that lie, and loading the
// kernel named by the boot options.
#include "load/kernel.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <string>
#include <vector>

#include "hostfw/network.h"
#include "kernel_images.h"
#include "load/bootfile.h"
#include "loader_fixture.h"
#include "temp_dir.h"

namespace {

using nimb::BootFile;
using nimbtest::Bytes;
using nimbtest::Command;
using nimbtest::Fat;
using nimbtest::kObjectDataStart;
using nimbtest::Object;
using nimbtest::Pattern;
using nimbtest::Segment;
using nimbtest::Thread;
using nimbtest::TrackedPoolBlocks;

constexpr uint64_t kUntouchedEntry = 0x5EED;

// Where a test file comes from (in traces, by number): a memory record, a
// volume file, or a memory record of a fat file (either order) with the
// kernel as its x86 slice, another processor's slice in front and one more
// slice behind.
enum class Source { kMemory, kVolume, kFatLittle, kFatBig };
const Source kAllSources[] = {Source::kMemory, Source::kVolume, Source::kFatLittle, Source::kFatBig};

// The kernel as the x86 slice at 0x3000, between two other slices.
Bytes WrapInFat(const Bytes &kernel, bool bigEndian) {
  uint32_t size = static_cast<uint32_t>(kernel.size());
  uint32_t behind = (0x3000 + size + 0xFFF) & ~0xFFFu;
  return Fat(bigEndian, {{18, 0x1000, 0x800}, {7, 0x3000, size}, {12, behind, 0x100}},
             {{0x1000, Pattern(0x800, 5)}, {0x3000, kernel}, {behind, Pattern(0x100, 6)}});
}

class KernelTest : public nimbtest::VolumeTest {
 protected:
  // Opens `bytes` as a file of the given kind; the bytes must outlive it.
  void Open(Source source, const Bytes &bytes, BootFile *file) {
    if (source == Source::kVolume) {
      dir_->File("k", bytes);
      ASSERT_EQ(nimb::BootFileOpen(nullptr, root_, u"k", file), EFI_SUCCESS);
      return;
    }
    *file = BootFile{};
    static uint8_t empty;
    file->buffer = bytes.empty() ? &empty : const_cast<uint8_t *>(bytes.data());
    file->size = bytes.size();
  }

  // The file as the source holds it.
  static Bytes Contents(Source source, const Bytes &kernel) {
    if (source == Source::kFatLittle || source == Source::kFatBig)
      return WrapInFat(kernel, source == Source::kFatBig);
    return kernel;
  }

  // Gives back everything a load took and puts the cursors and the entry
  // back, so that the next row starts afresh.
  void Forget() {
    nimb::TrackedFreeAll();
    nimb::gKernelRegionBase = 0xFFFFFFFF;
    nimb::gKernelRegionTop = 0;
    nimb::gKernelEntry = kUntouchedEntry;
  }

  // Console output since `mark` (a length of ConOutText).
  std::string OutputSince(size_t mark) const { return fw.ConOutText().substr(mark); }
};

// --- finding the slice ------------------------------------------------------------

TEST_F(KernelTest, FindSliceInBothOrdersAndFromBothKinds) {
  const Bytes x86 = Pattern(0x300, 2);
  const Bytes other = Pattern(0x200, 3);
  struct Row {
    std::string name;
    Bytes file;
    uint64_t size = 0;  // 0: refused
    uint64_t offset = 0;
    uint64_t nextRead = 0;  // where the next read starts
  };
  std::vector<Row> rows = {
      {"not fat", x86, 0x300, 0, 0},
      {"empty", {}},
      {"shorter than the fat test", Bytes(x86.begin(), x86.begin() + 7)},
  };
  for (bool big : {false, true}) {
    Bytes twoSlices = Fat(big, {{18, 0x1000, 0x200}, {7, 0x2000, 0x300}}, {{0x1000, other}, {0x2000, x86}});
    // The record behind the first reads as an x86 slice, but the count says
    // there is only one.
    Bytes countOfOne = twoSlices;
    (big ? nimbtest::PutBe32 : nimbtest::PutLe32)(countOfOne, 4, 1);
    std::vector<Row> fatRows = {
        {"one x86 slice", Fat(big, {{7, 0x1000, 0x300}}, {{0x1000, x86}}), 0x300, 0x1000, 0x1000},
        {"x86 slice behind another", twoSlices, 0x300, 0x2000, 0x2000},
        {"the first of two x86 slices",
         Fat(big, {{7, 0x1000, 0x200}, {7, 0x2000, 0x300}}, {{0x1000, other}, {0x2000, x86}}), 0x200, 0x1000,
         0x1000},
        {"no x86 slice", Fat(big, {{18, 0x1000, 0x200}, {0x1000007, 0x2000, 0x300}}, {{0x2000, x86}})},
        {"the count bounds the records", countOfOne},
        {"x86 slice of size 0", Fat(big, {{7, 0x1000, 0}}, {{0x1000, x86}})},
        {"cut off in the records", Fat(big, {{18, 0x1000, 0x200}}, {}, 3)},
        // The declared slice, even where the file ends first: the reads
        // come short.
        {"slice running past the end", Fat(big, {{7, 0x1000, 0x301}}, {{0x1000, x86}}), 0x301, 0x1000,
         0x1000},
        // Offset 0 means no seek: reading goes on behind the two records.
        {"x86 slice at offset 0", Fat(big, {{18, 0x1000, 0x200}, {7, 0, 0x300}}, {{0x1000, other}}), 0x300, 0,
         8 + 2 * 20},
    };
    for (Row &row : fatRows) {
      row.name += big ? " (big-endian)" : " (little-endian)";
      rows.push_back(row);
    }
  }
  for (const Row &row : rows) {
    for (Source source : {Source::kMemory, Source::kVolume}) {
      SCOPED_TRACE(row.name + " from source " + std::to_string(int(source)));
      size_t mark = fw.ConOutText().size();
      BootFile file;
      Open(source, row.file, &file);
      uint64_t size = 0xDEAD;
      uint64_t offset = 0xDEAD;
      ASSERT_EQ(nimb::BootFileFindSlice(&file, &size, &offset), row.size ? EFI_SUCCESS : EFI_LOAD_ERROR);
      EXPECT_EQ(size, row.size ? row.size : 0xDEAD);
      EXPECT_EQ(offset, row.size ? row.offset : 0xDEAD);
      if (row.size != 0) {
        uint8_t next[4];
        uint64_t count = sizeof(next);
        ASSERT_EQ(nimb::BootFileRead(&file, &count, next), EFI_SUCCESS);
        EXPECT_EQ(Bytes(next, next + count),
                  Bytes(row.file.begin() + row.nextRead, row.file.begin() + row.nextRead + 4));
      }
      // Nothing but the dots of volume reads: a missing slice is silent.
      EXPECT_EQ(OutputSince(mark).find_first_not_of('.'), std::string::npos) << OutputSince(mark);
      nimb::BootFileClose(&file);
    }
  }
  // The out arguments may both be absent.
  BootFile file;
  Open(Source::kMemory, rows[0].file, &file);
  EXPECT_EQ(nimb::BootFileFindSlice(&file, nullptr, nullptr), EFI_SUCCESS);
}

// --- placing segments ---------------------------------------------------------

TEST_F(KernelTest, SegmentsArePlacedAndTheirPagesCleared) {
  const Bytes data = Pattern(0x3000, 4);
  const uint32_t d = kObjectDataStart;
  // At `address`, the object's data from `from` for `count` bytes, then
  // zeroes up to `size`.
  struct Placed {
    uint64_t address, from, count, size;
  };
  struct Row {
    std::string name;
    std::vector<Bytes> commands;
    std::vector<Placed> placed;  // the lowest first, the highest last
    uint64_t entry;
  };
  const std::vector<Row> rows = {
      {"whole pages need no clearing",
       {Segment(0x200000, 0x2000, d, 0x2000), Thread(0x200010)},
       {{0x200000, 0, 0x2000, 0x2000}},
       0x200010},
      {"4097 bytes in memory and 1 in the file take two pages",
       {Segment(0x300000, 4097, d + 5, 1), Thread(0x300000)},
       {{0x300000, 5, 1, 0x2000}},
       0x300000},
      {"addresses above 0x3FFFFFFF keep their low 30 bits",
       {Segment(0xC0400000, 0x1800, d + 0x100, 0x800), Thread(0xC0400123)},
       {{0x400000, 0x100, 0x800, 0x2000}},
       0x400123},
      {"the last thread command counts",
       {Thread(0x100), Segment(0x200000, 0x10, d, 0x10), Thread(0x200004, 96)},
       {{0x200000, 0, 0x10, 0x1000}},
       0x200004},
      {"no thread command: entry 0", {Segment(0x200000, 0x10, d, 0x10)}, {{0x200000, 0, 0x10, 0x1000}}, 0},
      {"a segment without file bytes takes nothing, however large",
       {Segment(0x500000, 0xFFFFF000, 0, 0), Segment(0x200000, 0x10, d, 0x10)},
       {{0x200000, 0, 0x10, 0x1000}},
       0},
      {"segments need not ascend",
       {Segment(0x600000, 0x1000, d, 0x1000), Segment(0x200000, 0x1000, d + 0x1000, 0x1000)},
       {{0x200000, 0x1000, 0x1000, 0x1000}, {0x600000, 0, 0x1000, 0x1000}},
       0},
      {"other commands are stepped over",
       {Command(2, 24, {1, 0x200000, 0x100, 1}), Segment(0x200000, 0x100, d, 0x100),
        Command(0x80000022, 12, {5}), Thread(0x200000)},
       {{0x200000, 0, 0x100, 0x1000}},
       0x200000},
      {"data that ends early reads as zeroes, to the page's last byte",
       {Segment(0x200000, 0x1000, d + 0x2001, 0x1000)},
       {{0x200000, 0x2001, 0xFFF, 0x1000}},
       0},
      {"data that begins at the very end reads as zeroes",
       {Segment(0x200000, 0x1000, d + 0x3000, 0x1000)},
       {{0x200000, 0, 0, 0x1000}},
       0},
  };
  for (const Row &row : rows) {
    for (Source source : kAllSources) {
      SCOPED_TRACE(row.name + " from source " + std::to_string(int(source)));
      Forget();
      Bytes contents = Contents(source, Object{0xFEEDFACE, row.commands, data}.Build());
      BootFile file;
      Open(source, contents, &file);
      size_t mark = fw.ConOutText().size();
      ASSERT_EQ(nimb::LoadKernel(&file), EFI_SUCCESS) << OutputSince(mark);
      nimb::BootFileClose(&file);
      uint64_t pages = 0;
      for (const Placed &p : row.placed) {
        Bytes placed(data.begin() + p.from, data.begin() + p.from + p.count);
        placed.resize(p.size);  // zeroes behind the data
        EXPECT_EQ(nimbtest::Memory(p.address, p.size), placed) << std::hex << p.address;
        pages += p.size / 4096;
      }
      EXPECT_EQ(fw.AllocatedPages(), pages);
      EXPECT_EQ(nimb::gKernelEntry, row.entry);
      EXPECT_EQ(nimb::gKernelRegionBase, row.placed.front().address);
      EXPECT_EQ(nimb::gKernelRegionTop, row.placed.back().address + row.placed.back().size);
      EXPECT_EQ(TrackedPoolBlocks(), 0u) << "the commands buffer is given back";
    }
  }
}

TEST_F(KernelTest, ObjectsThatLieAreRefusedBeforeAnythingIsPlaced) {
  const Bytes data = Pattern(0x2000, 7);
  const uint32_t d = kObjectDataStart;
  const Bytes good = Segment(0x200000, 0x1000, d, 0x1000);
  struct Row {
    std::string name;
    Object object;
    std::string message = "";  // all but the bad magic are silent
  };
  auto with = [&](std::vector<Bytes> commands, int64_t count = -1, int64_t size = -1) {
    Object object{0xFEEDFACE, std::move(commands), data, count, size};
    return object;
  };
  Object cutHeader = with({good});
  cutHeader.cutAt = 27;
  Object cutCommands = with({good, Thread(0x200000)});
  cutCommands.data.clear();
  cutCommands.cutAt = 28 + 56 + 40;
  Object huge = with({good}, -1, 0x100001);
  huge.data = Bytes(0x101000);
  std::vector<Row> rows = {
      {"bad magic", {0xFEEDFACF, {good}, data}, "Nimb-O file has bad magic number 0xfeedfacf\r\n"},
      {"header cut off", cutHeader},
      {"commands cut off", cutCommands},
      {"commands larger than the slice", with({good}, -1, 0x4000)},
      {"commands above 1 MiB", huge},
      {"negative command count", with({good}, 0xFFFFFFFF)},
      {"more commands than the commands can hold", with({good, Thread(0)}, 18)},
      {"a count beyond the commands present", with({good, Thread(0)}, 3)},
      {"command length 0", with({good, Command(2, 0), Thread(0)})},
      {"command length 4", with({good, Command(2, 4), Thread(0)})},
      {"a command running past the commands", with({good, Command(2, 8), Command(2, 64)}, -1, 56 + 8 + 32)},
      {"a segment command too short for its fields", with({Segment(0x200000, 0x1000, d, 0x1000, 36)})},
      {"a thread command too short for its entry", with({good, Thread(0x200000, 59)})},
      {"more file bytes than pages", with({Segment(0x200000, 0x1000, d, 0x1001)})},
      {"file bytes without memory", with({Segment(0x200000, 0, d, 1)})},
      {"pages past 4 GiB", with({Segment(0x3FFFF000, 0xC0001001, d, 1)})},
      {"segment bytes beginning past the slice", with({Segment(0x200000, 0x1000, d + 0x2001, 1)})},
  };
  for (const Row &row : rows) {
    for (Source source : {Source::kMemory, Source::kFatBig}) {
      SCOPED_TRACE(row.name + " from source " + std::to_string(int(source)));
      Forget();
      Bytes contents = Contents(source, row.object.Build());
      BootFile file;
      Open(source, contents, &file);
      size_t mark = fw.ConOutText().size();
      unsigned poolCalls = fw.AllocatePoolCalls();
      EXPECT_EQ(nimb::LoadKernel(&file), EFI_LOAD_ERROR);
      EXPECT_EQ(OutputSince(mark), row.message);
      EXPECT_EQ(fw.AllocatedPages(), 0u) << "nothing placed";
      EXPECT_EQ(nimb::gKernelEntry, kUntouchedEntry);
      EXPECT_EQ(TrackedPoolBlocks(), 0u);
      // A size that is not believed is never asked of the pool.
      if (row.object.commandsSize > 0x100000)
        EXPECT_EQ(fw.AllocatePoolCalls(), poolCalls);
    }
  }
}

// --- the kernel of the boot options ---------------------------------------

TEST_F(KernelTest, LoadKernelFileOpensLoadsAndCloses) {
  Bytes kernel =
      Object{0xFEEDFACE, {Segment(0x200000, 0x10, kObjectDataStart, 0x10), Thread(0xC0200004)}, Pattern(0x10)}
          .Build();
  Bytes fat = WrapInFat(kernel, true);
  dir_->File("nimb_kernel", fat);
  hostfw::NetworkDevice network(fw);
  network.PutFile(u"nimb_kernel", fat);
  network.PutFile(u"net\\k", kernel);
  Bytes networkPath = network.FilePath(u"net\\k");
  Bytes volumePath = network.FilePath(u"nimb_kernel");

  struct Row {
    const char *name;
    const CHAR16 *kernelName;
    const Bytes *devicePath;
    bool overNetwork;
    EFI_STATUS status;
    std::string output;  // the dots of reading and of "Loading '...'..." left out
  };
  const Row rows[] = {
      {"by name from the volume", u"nimb_kernel", nullptr, false, EFI_SUCCESS, "Loading 'nimb_kernel'\r\n"},
      {"by name over LoadFile", u"nimb_kernel", nullptr, true, EFI_SUCCESS, "Loading 'nimb_kernel'\r\n"},
      {"by device path over LoadFile", u"other", &networkPath, true, EFI_SUCCESS, "Loading 'other'\r\n"},
      {"a missing file", u"missing", nullptr, false, EFI_NOT_FOUND,
       "Loading 'missing'\r\nCould not open file 'missing'\r\n"},
      // A device path with no LoadFile to fetch it has no source.
      {"a device path without LoadFile", u"nimb_kernel", &volumePath, false, EFI_INVALID_PARAMETER,
       "Loading 'nimb_kernel'\r\n"},
      // Boot options that could not be settled leave no name.
      {"no name", nullptr, nullptr, false, EFI_INVALID_PARAMETER, ""},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(row.name);
    Forget();
    nimb::gKernelName = row.kernelName;
    nimb::gKernelDevicePath =
        row.devicePath
            ? reinterpret_cast<EFI_DEVICE_PATH_PROTOCOL *>(const_cast<uint8_t *>(row.devicePath->data()))
            : nullptr;
    size_t mark = fw.ConOutText().size();
    EFI_LOAD_FILE_INTERFACE *loadFile = row.overNetwork ? network.Protocol() : nullptr;
    EXPECT_EQ(nimb::LoadKernelFile(loadFile, row.overNetwork ? nullptr : root_), row.status);
    std::string output = OutputSince(mark);
    output.erase(std::remove(output.begin(), output.end(), '.'), output.end());
    EXPECT_EQ(output, row.output);
    if (row.status == EFI_SUCCESS) {
      EXPECT_EQ(nimb::gKernelEntry, 0x200004u);
      EXPECT_EQ(std::memcmp(reinterpret_cast<void *>(0x200000), Pattern(0x10).data(), 0x10), 0);
    } else {
      EXPECT_EQ(nimb::gKernelEntry, kUntouchedEntry);
    }
    EXPECT_EQ(fw.OpenFiles(), 1u) << "only the root stays open";
    EXPECT_EQ(TrackedPoolBlocks(), 0u) << "the record's path and buffer are given back";
  }
}

}  // namespace
