// Tags on firmware allocations, their blocks, and giving everything back.
#include "memory/tracking.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <numeric>
#include <random>
#include <set>
#include <tuple>
#include <vector>

#include "loader_fixture.h"

namespace {

using nimb::gFreeMemoryTags;
using nimb::gMemoryTagBlocks;
using nimb::gMemoryTags;
using nimb::MemoryTag;

class TrackingTest : public nimbtest::LoaderTest {
 protected:
  static size_t Length(const MemoryTag *list) {
    size_t n = 0;
    for (; list != nullptr; list = list->next)
      n++;
    return n;
  }
};

TEST_F(TrackingTest, BlocksOfTagsAndTheirReuse) {
  std::vector<void *> buffers = {nimb::TrackedAllocatePool(40)};
  auto *block = static_cast<MemoryTag *>(gMemoryTagBlocks->poolAddress);
  // The block's own record is its last; the highest free tag goes first.
  // A tag block carries no tag.
  EXPECT_EQ(std::make_tuple(gMemoryTagBlocks, gMemoryTagBlocks->pageCount + gMemoryTagBlocks->pageAddress,
                            gMemoryTags, gMemoryTags->poolAddress, gFreeMemoryTags, fw.LivePoolBlocks()),
            std::make_tuple(&block[127], UINT64{0}, &block[126], buffers[0], &block[125], size_t{2}));
  while (buffers.size() < 127)
    buffers.push_back(nimb::TrackedAllocatePool(8));
  EXPECT_EQ(gFreeMemoryTags, nullptr);
  // A freed tag is used again before any block is made.
  ASSERT_EQ(nimb::TrackedFree(buffers[50]), EFI_SUCCESS);
  EXPECT_EQ(gFreeMemoryTags->poolAddress, buffers[50]);
  EXPECT_EQ(Length(gFreeMemoryTags), 1u);
  nimb::TrackedAllocatePool(8);
  EXPECT_EQ(Length(gMemoryTagBlocks), 1u);
  nimb::TrackedAllocatePool(8);
  EXPECT_EQ(std::make_tuple(Length(gMemoryTagBlocks), Length(gMemoryTags), Length(gFreeMemoryTags)),
            std::make_tuple(2u, 128u, 126u));
  // One FreePool for each live buffer and each block; then a fresh block.
  unsigned frees = fw.FreePoolCalls();
  nimb::TrackedFreeAll();
  EXPECT_EQ(fw.FreePoolCalls() - frees, 128u + 2u);
  EXPECT_TRUE(gMemoryTags == nullptr && gFreeMemoryTags == nullptr && gMemoryTagBlocks == nullptr);
  ExpectNothingHeld();
  unsigned pools = fw.AllocatePoolCalls();
  ASSERT_NE(nimb::TrackedAllocatePool(16), nullptr);
  EXPECT_EQ(fw.AllocatePoolCalls() - pools, 2u);
}

TEST_F(TrackingTest, FreeWithoutATagOrRefusedByTheFirmware) {
  void *tracked = nimb::TrackedAllocatePool(16);
  // No tag: the memory still goes back, and the firmware's status is all.
  EXPECT_EQ(nimb::TrackedFree(nimb::AllocatePool(16)), EFI_SUCCESS);
  // Refused by the firmware: the tag stays.
  fw.FailCall("FreePool", 1, EFI_INVALID_PARAMETER);
  EXPECT_EQ(nimb::TrackedFree(tracked), EFI_INVALID_PARAMETER);
  ASSERT_EQ(Length(gMemoryTags), 1u);
  EXPECT_EQ(gMemoryTags->poolAddress, tracked);
}

TEST_F(TrackingTest, PagesAndForeignPoolAreTaggedOnlyWhenTheFirmwareGivesThem) {
  EFI_PHYSICAL_ADDRESS address = 0x200000;
  ASSERT_EQ(nimb::TrackedAllocatePages(AllocateAddress, EfiLoaderData, 4, &address), EFI_SUCCESS);
  ASSERT_EQ(Length(gMemoryTags), 1u);
  EXPECT_EQ(std::make_tuple(gMemoryTags->poolAddress, gMemoryTags->pageCount, gMemoryTags->pageAddress),
            std::make_tuple(static_cast<void *>(nullptr), UINT64{4}, UINT64{0x200000}));
  fw.FailAllocation(1);
  EFI_PHYSICAL_ADDRESS other = 0;
  EXPECT_EQ(nimb::TrackedAllocatePages(AllocateAnyPages, EfiLoaderData, 1, &other), EFI_OUT_OF_RESOURCES);
  fw.FailAllocation(1);
  EXPECT_EQ(nimb::TrackedAllocatePool(8), nullptr);
  EXPECT_EQ(Length(gMemoryTags), 1u);
  void *foreign = nimb::AllocatePool(32);
  MemoryTag *tag = nimb::TrackPool(foreign);
  EXPECT_EQ(tag, gMemoryTags);
  EXPECT_EQ(tag->poolAddress, foreign);
  nimb::TrackedFreeAll();
  ExpectNothingHeld();
}

TEST_F(TrackingTest, ARefusedBufferLeavesNoTagAndNoBlockIsFatal) {
  fw.FailCall("AllocatePool");  // the buffer
  EXPECT_EQ(nimb::TrackedAllocatePool(8), nullptr);
  EXPECT_EQ(gMemoryTagBlocks, nullptr);
  fw.FailCall("AllocatePool", 2);  // the tag block
  hostfw::RunResult result = fw.Call([] { nimb::TrackedAllocatePool(8); });
  EXPECT_EQ(result.status, EFI_ABORTED);
  EXPECT_EQ(fw.ConOutText(), "Can't allocate memory tag");
}

// Pool addresses below this are the test's own: its firmware takes them back
// without a look, so that they may lie where the index's slots collide.
constexpr UINTN kScatteredLimit = 1 << 20;
EFI_STATUS(EFIAPI *gRealFreePool)(VOID *);
EFI_STATUS EFIAPI FreeScattered(VOID *buffer) {
  return reinterpret_cast<UINTN>(buffer) < kScatteredLimit ? EFI_SUCCESS : gRealFreePool(buffer);
}

// Many live tags, freed oldest first (a long walk, which makes the index),
// then in any order between allocations (the index follows them and grows),
// on the firmware's own pool and on addresses whose slots in the index
// collide: the live ones stay tagged, and everything goes back.
TEST_F(TrackingTest, ManyFreesInAnyOrder) {
  for (bool scattered : {false, true}) {
    EFI_BOOT_SERVICES services = *fw.BootServices();
    gRealFreePool = services.FreePool;
    services.FreePool = FreeScattered;
    nimb::gBS = &services;
    std::mt19937 random(3);
    std::vector<UINTN> addresses(kScatteredLimit / 8 - 1);
    std::iota(addresses.begin(), addresses.end(), 1);
    std::shuffle(addresses.begin(), addresses.end(), random);
    std::vector<void *> live;
    size_t allocations = 0, frees = 0, pages = 0;
    auto allocate = [&] {
      void *scatteredAddress = reinterpret_cast<void *>(8 * addresses[allocations++]);
      live.push_back(scattered ? nimb::TrackPool(scatteredAddress)->poolAddress
                               : nimb::TrackedAllocatePool(8));
      EFI_PHYSICAL_ADDRESS address = 0;
      if (scattered && allocations % 400 == 200)
        pages += nimb::TrackedAllocatePages(AllocateAnyPages, EfiLoaderData, 1, &address) == EFI_SUCCESS;
    };
    auto free = [&](size_t which) {
      ASSERT_EQ(nimb::TrackedFree(live[which]), EFI_SUCCESS);
      live.erase(live.begin() + which);
      if (++frees % 64 != 0)
        return;
      std::multiset<void *> tagged;
      for (const MemoryTag *tag = gMemoryTags; tag != nullptr && tagged.size() <= live.size();
           tag = tag->next)
        if (tag->poolAddress != nullptr)
          tagged.insert(tag->poolAddress);
      ASSERT_EQ(tagged, std::multiset<void *>(live.begin(), live.end())) << scattered << " after " << frees;
    };
    while (allocations < 1600)
      allocate();
    for (size_t i = 0; i < 300; i++)
      free(0);
    EXPECT_EQ(nimb::TrackedFree(nimb::AllocatePool(8)), EFI_SUCCESS) << "untracked";
    for (size_t step = 0; step < 8000 && !HasFailure(); step++)
      random() % 3 != 0 ? allocate() : free(random() % live.size());
    while (!live.empty() && !HasFailure())
      free(random() % live.size());
    ASSERT_FALSE(HasFailure());
    EXPECT_EQ(Length(gMemoryTags), pages);
    if (!scattered)
      EXPECT_EQ(fw.LivePoolBlocks(), Length(gMemoryTagBlocks)) << "nothing but the tag blocks";
    nimb::TrackedFreeAll();
    ExpectNothingHeld();
    Attach();
  }
}

}  // namespace
