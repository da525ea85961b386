// The kobj tool's ELF reader: which ELF files it takes and why it refuses the
// others (the objects it writes are loaded by the loader's tests).
#include <gtest/gtest.h>

#include <functional>
#include <string>
#include <tuple>
#include <vector>

#include "kernel_images.h"
#include "kobj/writer.h"

namespace {

using nimbtest::Bytes;
using nimbtest::ElfSegment;
using nimbtest::Pattern;
using nimbtest::PutLe16;
using nimbtest::PutLe32;

// Program headers start at byte 52, 32 bytes each; paddr is at +12, memory
// size at +20.
constexpr size_t kPhdr = 52;

Bytes GoodElf() {
  return nimbtest::Elf(0x00100010, {{1, 0x00100000, 0x00100000, Pattern(0x20), 0x20},
                                    {1, 0x00101000, 0x00101000, Pattern(0x10), 0x1800}});
}

TEST(KobjElfTest, RefusesWhatTheLoaderCouldNotPlace) {
  struct Row {
    const char *name;
    std::function<void(Bytes &)> spoil;
    std::string error;  // a part of the message
  };
  const Row rows[] = {
      {"not ELF", [](Bytes &e) { e[1] = 'X'; }, "not an ELF file"},
      {"cut in the header", [](Bytes &e) { e.resize(40); }, "ELF header cut off"},
      {"64-bit", [](Bytes &e) { e[4] = 2; }, "64-bit"},
      {"unknown class", [](Bytes &e) { e[4] = 9; }, "unknown ELF class 9"},
      {"big-endian", [](Bytes &e) { e[5] = 2; }, "not a little-endian"},
      {"relocatable object", [](Bytes &e) { PutLe16(e, 16, 1); }, "not an executable (ELF type 1)"},
      {"position-independent", [](Bytes &e) { PutLe16(e, 16, 3); }, "--no-pie"},
      {"another processor", [](Bytes &e) { PutLe16(e, 18, 62); },
       "not a 32-bit x86 program (ELF machine 62)"},
      {"program headers of another size", [](Bytes &e) { PutLe16(e, 42, 56); }, "of 56 bytes"},
      {"program headers outside the file", [](Bytes &e) { PutLe32(e, 28, 0xFFFFFF00); }, "outside the file"},
      {"segment bytes outside the file", [](Bytes &e) { PutLe32(e, kPhdr + 4, 0x10000); },
       "outside the file"},
      {"more file bytes than memory", [](Bytes &e) { PutLe32(e, kPhdr + 20, 0x10); },
       "more bytes in the file"},
      {"no loadable segment", [](Bytes &e) { PutLe32(e, kPhdr, 4), PutLe32(e, kPhdr + 32, 6); },
       "no loadable segment"},
      {"only empty loadable segments",
       [](Bytes &e) {
         for (size_t at : {kPhdr, kPhdr + 32})
           PutLe32(e, at + 16, 0), PutLe32(e, at + 20, 0);
       },
       "no loadable segment"},
      {"an address off a page boundary", [](Bytes &e) { PutLe32(e, kPhdr + 32 + 12, 0x00101800); },
       "not on a 4096-byte boundary"},
      // 0x40100000 lands on the first segment's page.
      {"segments sharing a page once placed", [](Bytes &e) { PutLe32(e, kPhdr + 32 + 12, 0x40100000); },
       "overlap"},
      {"segments overlapping", [](Bytes &e) { PutLe32(e, kPhdr + 20, 0x1001); }, "overlap"},
      {"pages past 4 GiB", [](Bytes &e) { PutLe32(e, kPhdr + 32 + 20, 0xFFF00000); }, "past 4 GiB"},
      {"entry outside the segments", [](Bytes &e) { PutLe32(e, 24, 0x00100020); }, "entry point 0x100020"},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(row.name);
    Bytes elf = GoodElf();
    row.spoil(elf);
    kobj::Kernel kernel;
    kernel.entry = 0x77;
    std::string error = kobj::ReadElf(elf, &kernel);
    EXPECT_NE(error.find(row.error), std::string::npos) << error;
    EXPECT_EQ(kernel.entry, 0x77u) << "nothing is given back on a refusal";
  }
}

TEST(KobjElfTest, TakesLoadableSegmentsAtTheirPhysicalAddresses) {
  Bytes elf = nimbtest::Elf(0xC0100004, {{1, 0xC0100000, 0x00100000, Pattern(0x30), 0x30},
                                         {6, 0x10, 0x10, Pattern(4), 4},      // not loadable
                                         {1, 0xC0200000, 0xC0200000, {}, 0},  // empty
                                         {1, 0xC0300000, 0x00300000, {}, 0x2000}});
  kobj::Kernel kernel;
  ASSERT_EQ(kobj::ReadElf(elf, &kernel), "");
  EXPECT_EQ(kernel.entry, 0xC0100004u);
  ASSERT_EQ(kernel.segments.size(), 2u);
  const auto &[first, second] = std::tie(kernel.segments[0], kernel.segments[1]);
  EXPECT_EQ(std::make_tuple(first.address, first.memorySize, first.bytes),
            std::make_tuple(0x100000, 0x30, Pattern(0x30)));
  EXPECT_EQ(std::make_tuple(second.address, second.memorySize, second.bytes),
            std::make_tuple(0x300000, 0x2000, Bytes()));
}

}  // namespace
