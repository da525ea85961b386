// The runtime address map: addresses, the firmware's call, the copy, the
// pointers that follow their regions, the rewritten map, and the stop when
// the firmware refuses the map.
#include "memory/runtime_map.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <iterator>
#include <sstream>
#include <string>
#include <vector>

#include "boot/stop.h"
#include "loader_fixture.h"

namespace {

constexpr UINT64 kRt = EFI_MEMORY_RUNTIME;
constexpr UINT64 kStride = hostfw::kDescriptorSize;
constexpr UINT8 kDestinationFill = 0x77;

struct Region {
  UINT32 type;
  UINT64 physical;
  UINT64 pages;
  UINT64 attribute;
  UINT64 virtualStart;  // as the firmware left it
  UINT64 expected;      // VirtualStart after the call
};

bool Moves(const Region &r) {
  return r.type == EfiRuntimeServicesCode || r.type == EfiRuntimeServicesData;
}
bool Announced(const Region &r) {
  return r.type != EfiReservedMemoryType && (r.attribute & kRt) != 0;
}
bool InArena(UINT64 address) {
  return address >= hostfw::kArenaBase && address < hostfw::kArenaLimit;
}
UINT8 *At(UINT64 address) {
  return reinterpret_cast<UINT8 *>(address);
}
UINT8 Fill(size_t index) {
  return UINT8(0x31 + index);
}
bool Filled(UINT64 address, UINT64 pages, UINT8 byte) {
  return std::all_of(At(address), At(address + pages * EFI_PAGE_SIZE), [byte](UINT8 b) { return b == byte; });
}

std::string Describe(UINT32 type, UINT64 physical, UINT64 virtualStart, UINT64 pages, UINT64 attribute) {
  std::ostringstream text;
  text << std::hex << "type " << type << " at " << physical << " -> " << virtualStart << ", " << pages
       << " pages, " << attribute;
  return text.str();
}
std::string Describe(const EFI_MEMORY_DESCRIPTOR &d) {
  return Describe(d.Type, d.PhysicalStart, d.VirtualStart, d.NumberOfPages, d.Attribute);
}

// A firmware of its own for one call, and a map of `regions` at the
// firmware's stride, in a buffer with room for as many descriptors again
// behind them. Each region in the arena is declared and filled with a byte
// of its own; the area from `next` on that the announced regions take is
// declared and filled with kDestinationFill.
class Scene {
 public:
  Scene(const std::vector<Region> &regions, UINT64 next, bool declareArea = true)
      : regions(regions), next(next) {
    nimbtest::AttachTo(fw);
    UINT64 pages = 0;
    map.assign(2 * regions.size() * kStride, 0xA5);
    for (size_t i = 0; i < regions.size(); i++) {
      const Region &r = regions[i];
      pages += Announced(r) ? r.pages : 0;
      if (InArena(r.physical)) {
        fw.AddMemoryRegion(EFI_MEMORY_TYPE(r.type), r.physical, r.pages, r.attribute);
        std::memset(At(r.physical), Fill(i), r.pages * EFI_PAGE_SIZE);
      }
      EFI_MEMORY_DESCRIPTOR d = {r.type, 0, r.physical, r.virtualStart, r.pages, r.attribute};
      std::memcpy(Descriptor(i), &d, sizeof(d));
    }
    if (pages != 0 && declareArea) {
      fw.AddMemoryRegion(EfiLoaderData, next, pages, 0);
      std::memset(At(next), kDestinationFill, pages * EFI_PAGE_SIZE);
    }
  }
  ~Scene() { nimbtest::ResetLoaderState(); }

  EFI_MEMORY_DESCRIPTOR *Descriptor(size_t i) {
    return reinterpret_cast<EFI_MEMORY_DESCRIPTOR *>(map.data() + i * kStride);
  }
  std::vector<std::string> List(size_t from, size_t to) {
    std::vector<std::string> out;
    for (size_t i = from; i < to; i++)
      out.push_back(Describe(*Descriptor(i)));
    return out;
  }
  hostfw::RunResult Map(bool resume) {
    EXPECT_EQ(fw.BootServices()->ExitBootServices(fw.ImageHandle(), fw.MapKey()), EFI_SUCCESS);
    nimb::gBS = nullptr;
    EFI_MEMORY_DESCRIPTOR *start = Descriptor(0);
    EFI_MEMORY_DESCRIPTOR *end = Descriptor(regions.size());
    cursor = resume ? start : end;
    return fw.Call([&] {
      EXPECT_EQ(nimb::MapRuntimeServices(start, end, &cursor, kStride, EFI_MEMORY_DESCRIPTOR_VERSION, &next,
                                         resume),
                0u);
    });
  }

  hostfw::Firmware fw;
  std::vector<Region> regions;
  UINT64 next;
  std::vector<UINT8> map;
  EFI_MEMORY_DESCRIPTOR *cursor = nullptr;
};

class RuntimeMapTest : public nimbtest::LoaderTest {};

TEST(LShiftU64Test, ShiftsUpTo63BitsAndGivesZeroBeyond) {
  EXPECT_EQ(nimb::LShiftU64(3, 12), 0x3000u);
  EXPECT_EQ(nimb::LShiftU64(1, 63), 0x8000000000000000ull);
  EXPECT_EQ(nimb::LShiftU64(1, 64), 0u);
}

TEST_F(RuntimeMapTest, AddressesCopiesAndTheRewrittenMapInBothModes) {
  struct Row {
    const char *what;
    std::vector<Region> regions;
    UINT64 nextAfter;
  };
  const Row rows[] = {
      {"runtime regions of 2, 1 and 4 pages",
       {{EfiRuntimeServicesCode, 0x200000, 2, kRt, 0, 0x100000},
        {EfiRuntimeServicesData, 0x300000, 1, kRt, 0, 0x102000},
        {EfiRuntimeServicesCode, 0x400000, 4, kRt | 1, 0, 0x103000}},
       0x107000},
      {"reserved memory with the runtime bit",
       {{EfiReservedMemoryType, 0x500000, 1, kRt | 0xF, 0x5555000, 0x5555000},
        {EfiRuntimeServicesData, 0x200000, 2, kRt | 0xF, 0, 0x100000}},
       0x102000},
      {"memory-mapped I/O with the runtime bit",
       {{EfiMemoryMappedIO, 0x600000, 2, kRt | 1, 0, 0x100000},
        {EfiRuntimeServicesData, 0x200000, 1, kRt, 0, 0x102000},
        {EfiBootServicesData, 0x700000, 4, 0xF, 0, 0}},
       0x103000},
      {"no runtime region",
       {{EfiBootServicesData, 0x200000, 1, 0xF, 0, 0}, {EfiLoaderData, 0x300000, 2, 0xF, 0, 0}},
       0x100000},
  };
  for (const Row &row : rows) {
    for (bool resume : {false, true}) {
      SCOPED_TRACE(std::string(row.what) + (resume ? ", resume" : ", normal boot"));
      Scene scene(row.regions, 0x100000);
      ASSERT_EQ(scene.Map(resume).end, hostfw::RunEnd::Returned);
      EXPECT_EQ(scene.next, row.nextAfter);

      // What the firmware was given, and the map as the call leaves it.
      std::vector<std::string> announced, final, added;
      size_t n = row.regions.size();
      for (const Region &r : row.regions) {
        UINT64 attribute = r.type == EfiReservedMemoryType ? r.attribute & ~kRt : r.attribute;
        if (resume && !Announced(r))
          continue;
        announced.push_back(Describe(r.type, r.physical, r.expected, r.pages, attribute));
        if (resume) {
          final.push_back(
              Describe(r.type, Moves(r) ? r.expected : r.physical, r.expected, r.pages, attribute));
        } else if (Moves(r)) {
          final.push_back(Describe(EfiConventionalMemory, r.physical, r.expected, r.pages, attribute & ~kRt));
          added.push_back(Describe(r.type, r.expected, r.expected, r.pages, attribute));
        } else {
          final.push_back(announced.back());
        }
      }
      ASSERT_TRUE(scene.fw.VirtualMapSet());
      std::vector<std::string> given;
      for (const EFI_MEMORY_DESCRIPTOR &d : scene.fw.VirtualMap())
        given.push_back(Describe(d));
      EXPECT_EQ(given, announced);
      final.insert(final.end(), added.begin(), added.end());
      EXPECT_EQ(scene.cursor, scene.Descriptor(final.size()));
      EXPECT_EQ(scene.List(0, final.size()), final);
      if (!resume)
        EXPECT_EQ(final.size(), n + added.size());

      // Only runtime code and data is copied, and only a normal boot clears
      // the old place.
      for (size_t i = 0; i < n; i++) {
        const Region &r = row.regions[i];
        SCOPED_TRACE(Describe(r.type, r.physical, r.expected, r.pages, r.attribute));
        if (Moves(r)) {
          EXPECT_TRUE(Filled(r.expected, r.pages, Fill(i)));
          EXPECT_TRUE(Filled(r.physical, r.pages, resume ? Fill(i) : 0));
        } else {
          EXPECT_TRUE(Filled(r.physical, r.pages, Fill(i)));
          if (Announced(r))
            EXPECT_TRUE(Filled(r.expected, r.pages, kDestinationFill));
        }
      }
    }
  }
}

TEST_F(RuntimeMapTest, TableEntriesAndTheSystemTableFollowTheirRegion) {
  // Region A: 2 pages at 0x200000 -> 0x100000; region B: 1 page at 0x300000
  // -> 0x102000.
  const std::vector<Region> regions = {{EfiRuntimeServicesData, 0x200000, 2, kRt, 0, 0x100000},
                                       {EfiRuntimeServicesCode, 0x300000, 1, kRt, 0, 0x102000}};
  struct Entry {
    UINT64 before;
    UINT64 after;
  };
  const Entry entries[] = {
      {0x200000, 0x100000},  // first byte of A
      {0x201FFF, 0x101FFF},  // last byte of A
      {0x202000, 0x202000},  // first byte behind A
      {0x1FFFFF, 0x1FFFFF},  // last byte before A
      {0x300010, 0x102010},  // inside B
      {0x301000, 0x301000},  // first byte behind B
      {0x7000, 0x7000},      // in no region
  };
  for (bool resume : {false, true}) {
    for (bool inside : {false, true}) {
      SCOPED_TRACE(std::string(resume ? "resume" : "normal boot") + (inside ? ", system table in A" : ""));
      Scene scene(regions, 0x100000);
      for (const Entry &e : entries)
        scene.fw.AddConfigurationTable(gEfiAcpi20TableGuid, At(e.before));
      EFI_SYSTEM_TABLE *table = scene.fw.SystemTable();
      EFI_SYSTEM_TABLE copy = *table;
      if (inside) {
        table = reinterpret_cast<EFI_SYSTEM_TABLE *>(0x200100);
        *table = copy;
        nimb::gST = table;
      }
      ASSERT_EQ(scene.Map(resume).end, hostfw::RunEnd::Returned);
      EFI_SYSTEM_TABLE *expected = inside ? reinterpret_cast<EFI_SYSTEM_TABLE *>(0x100100) : table;
      EXPECT_EQ(nimb::gST, expected);
      EXPECT_EQ(std::memcmp(nimb::gST, &copy, sizeof(copy)), 0);
      // Kept by hostfw outside the map, the entries are fixed in place.
      for (size_t i = 0; i < std::size(entries); i++) {
        EXPECT_EQ(copy.ConfigurationTable[i].VendorTable, At(entries[i].after)) << "entry " << i;
      }
    }
  }
}

TEST_F(RuntimeMapTest, ARefusedMapStopsWithoutBootServices) {
  for (bool resume : {false, true}) {
    SCOPED_TRACE(resume ? "resume" : "normal boot");
    Scene scene({{EfiRuntimeServicesData, 0x200000, 1, kRt, 0, 0x100000}}, 0x100000);
    EFI_SYSTEM_TABLE *table = nimb::gST;
    scene.fw.FailCall("SetVirtualAddressMap", 1, EFI_INVALID_PARAMETER);
    hostfw::RunResult run = scene.Map(resume);
    EXPECT_EQ(run.end, resume ? hostfw::RunEnd::Reset : hostfw::RunEnd::Halted);
    if (resume)
      EXPECT_EQ(run.resetType, EfiResetCold);
    EXPECT_STREQ(nimb::gStopMessage, "Error in SetVirtualAddressMap\n");
    EXPECT_TRUE(scene.fw.ViolationsAfterExit().empty());
    EXPECT_TRUE(scene.fw.ConOutCalls().empty());
    EXPECT_EQ(nimb::gST, table);
    EXPECT_TRUE(Filled(0x100000, 1, kDestinationFill));
    EXPECT_TRUE(Filled(0x200000, 1, Fill(0)));
  }
}

// New places over old ones: each region arrives whole, and a normal boot
// clears only what lies outside the runtime area; regions that would each
// overwrite the other stop the run.
TEST_F(RuntimeMapTest, OverlappingPlacesAreCopiedInASafeOrder) {
  struct Row {
    const char *what;
    std::vector<Region> regions;
    UINT64 next;
    bool ring;
  };
  const UINT32 c = EfiRuntimeServicesCode, d = EfiRuntimeServicesData;
  const Row rows[] = {
      {"down over its own old place", {{c, 0x102000, 4, kRt, 0, 0x100000}}, 0x100000, false},
      {"up over its own old place", {{c, 0x100000, 4, kRt, 0, 0x102000}}, 0x102000, false},
      {"over the old place of the next region",
       {{d, 0x100000, 2, kRt, 0, 0x101000}, {c, 0x102000, 2, kRt, 0, 0x103000}},
       0x101000,
       false},
      {"over the old place of the region before",
       {{d, 0x104000, 1, kRt, 0, 0x101000}, {c, 0x100000, 2, kRt, 0, 0x102000}},
       0x101000,
       false},
      {"two regions trading places",
       {{d, 0x102000, 1, kRt, 0, 0x101000}, {c, 0x101000, 1, kRt, 0, 0x102000}},
       0x101000,
       true},
  };
  for (const Row &row : rows) {
    for (bool resume : {false, true}) {
      SCOPED_TRACE(std::string(row.what) + (resume ? ", resume" : ", normal boot"));
      Scene scene(row.regions, row.next, /*declareArea=*/false);
      hostfw::RunResult run = scene.Map(resume);
      if (row.ring) {
        EXPECT_EQ(run.end, resume ? hostfw::RunEnd::Reset : hostfw::RunEnd::Halted);
        EXPECT_STREQ(nimb::gStopMessage, "Runtime regions overlap\n");
        continue;
      }
      ASSERT_EQ(run.end, hostfw::RunEnd::Returned);
      for (size_t i = 0; i < row.regions.size(); i++) {
        const Region &r = row.regions[i];
        EXPECT_EQ(scene.Descriptor(i)->VirtualStart, r.expected) << i;
        EXPECT_TRUE(Filled(r.expected, r.pages, Fill(i))) << i;
        if (!resume) {
          for (UINT64 page = r.physical; page < r.physical + r.pages * EFI_PAGE_SIZE; page += EFI_PAGE_SIZE) {
            if (page < row.next || page >= scene.next)
              EXPECT_TRUE(Filled(page, 1, 0)) << std::hex << page;
          }
        }
      }
    }
  }
}

// Free memory from kFree on, and the row's descriptors.
TEST_F(RuntimeMapTest, TheRuntimeAreaMustLieInFreeMemoryBelow4GiB) {
  const UINT64 kFree = 0x100000, n = 0x40, p = EFI_PAGE_SIZE, kLimit = 0x100000000;
  const UINT32 code = EfiRuntimeServicesCode, free = EfiConventionalMemory;
  struct Row {
    const char *what;
    std::vector<EFI_MEMORY_DESCRIPTOR> extra;
    UINT64 start, spare;
    bool free;
  };
  const Row rows[] = {
      {"runtime pages and spare fit", {{code, 0, 0x300000, 0, 4, kRt}}, kFree, 0x2000, true},
      {"across two free descriptors", {{free, 0, kFree + n * p, 0, 8, 0}}, kFree + (n - 2) * p, 0x4000, true},
      {"the spare is not written: it may lie in used memory", {}, kFree + (n - 1) * p, 0x2000, true},
      {"the runtime pages run past it", {{code, 0, 0x300000, 0, n, kRt}}, kFree + p, 0, false},
      {"reserved and non-runtime pages take no room, up to 4 GiB",
       {{EfiReservedMemoryType, 0, 0x300000, 0, n, kRt}, {EfiBootServicesData, 0, 0x400000, 0, n, 0}},
       kFree,
       kLimit - kFree,
       true},
      {"memory-mapped I/O takes addresses, not memory",
       {{code, 0, 0x300000, 0, 4, kRt}, {EfiMemoryMappedIO, 0, 0xFEC00000, 0, 4 * n, kRt}},
       kFree,
       0,
       true},
      {"a region's new place is in used memory",
       {{EfiLoaderData, 0, 0x80000, 0, 0x80, 0}, {code, 0, 0x300000, 0, 1, kRt}},
       0x90000,
       0,
       false},
      {"beyond 4 GiB", {{free, 0, 0xFFFFF000, 0, 0x100, 0}}, 0xFFFFF000, 0x2000, false},
  };
  for (const Row &row : rows) {
    std::vector<EFI_MEMORY_DESCRIPTOR> map = {{free, 0, kFree, 0, n, 0xF}};
    map.insert(map.end(), row.extra.begin(), row.extra.end());
    EXPECT_EQ(nimb::RuntimeAreaIsFree(map.data(), map.data() + map.size(), sizeof(EFI_MEMORY_DESCRIPTOR),
                                      row.start, row.spare),
              row.free)
        << row.what;
  }
}

}  // namespace
