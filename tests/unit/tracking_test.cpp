// Tags on firmware allocations, their blocks, and giving everything back.
#include "memory/tracking.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <random>
#include <set>
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

TEST_F(TrackingTest, ABlockHoldsItsOwnRecordLastAndHandsOutTheHighestTagFirst) {
  void *buffer = nimb::TrackedAllocatePool(40);
  ASSERT_NE(buffer, nullptr);
  ASSERT_NE(gMemoryTagBlocks, nullptr);
  auto *block = static_cast<MemoryTag *>(gMemoryTagBlocks->poolAddress);
  EXPECT_EQ(gMemoryTagBlocks, &block[127]);
  EXPECT_EQ(gMemoryTagBlocks->pageCount, 0u);
  EXPECT_EQ(gMemoryTagBlocks->pageAddress, 0u);
  EXPECT_EQ(gMemoryTagBlocks->next, nullptr);
  EXPECT_EQ(gMemoryTags, &block[126]);
  EXPECT_EQ(gMemoryTags->poolAddress, buffer);
  EXPECT_EQ(gMemoryTags->next, nullptr);
  EXPECT_EQ(gFreeMemoryTags, &block[125]);
  EXPECT_EQ(Length(gFreeMemoryTags), 126u);
  // Tag blocks themselves carry no tag: two pool blocks, one tag.
  EXPECT_EQ(fw.LivePoolBlocks(), 2u);
}

TEST_F(TrackingTest, The128thLiveTagMakesASecondBlockAndFreedTagsComeFirst) {
  std::vector<void *> buffers;
  for (int i = 0; i < 127; i++)
    buffers.push_back(nimb::TrackedAllocatePool(8));
  EXPECT_EQ(Length(gMemoryTagBlocks), 1u);
  EXPECT_EQ(gFreeMemoryTags, nullptr);

  // A freed tag is used again before any block is made.
  ASSERT_EQ(nimb::TrackedFree(buffers[50]), EFI_SUCCESS);
  EXPECT_EQ(Length(gFreeMemoryTags), 1u);
  buffers[50] = nimb::TrackedAllocatePool(8);
  EXPECT_EQ(Length(gMemoryTagBlocks), 1u);

  buffers.push_back(nimb::TrackedAllocatePool(8));
  EXPECT_EQ(Length(gMemoryTagBlocks), 2u);
  EXPECT_EQ(Length(gMemoryTags), 128u);
  EXPECT_EQ(Length(gFreeMemoryTags), 126u);

  nimb::TrackedFreeAll();
  ExpectNothingHeld();
}

TEST_F(TrackingTest, FreeingTheFirstOfTwoLeavesTheSecondTagged) {
  void *first = nimb::TrackedAllocatePool(16);
  void *second = nimb::TrackedAllocatePool(16);
  ASSERT_EQ(nimb::TrackedFree(first), EFI_SUCCESS);
  ASSERT_EQ(Length(gMemoryTags), 1u);
  EXPECT_EQ(gMemoryTags->poolAddress, second);
  EXPECT_EQ(gFreeMemoryTags->poolAddress, first);

  unsigned before = fw.FreePoolCalls();
  nimb::TrackedFreeAll();
  // One call for the live buffer, one for the block.
  EXPECT_EQ(fw.FreePoolCalls() - before, 2u);
  EXPECT_EQ(gMemoryTags, nullptr);
  EXPECT_EQ(gFreeMemoryTags, nullptr);
  EXPECT_EQ(gMemoryTagBlocks, nullptr);
  ExpectNothingHeld();

  // The next allocation starts a fresh block.
  unsigned pools = fw.AllocatePoolCalls();
  ASSERT_NE(nimb::TrackedAllocatePool(16), nullptr);
  EXPECT_EQ(fw.AllocatePoolCalls() - pools, 2u);
  EXPECT_EQ(Length(gMemoryTagBlocks), 1u);
}

TEST_F(TrackingTest, FreeWithoutATagOrRefusedByTheFirmware) {
  void *tracked = nimb::TrackedAllocatePool(16);
  void *untracked = nimb::AllocatePool(16);
  ASSERT_NE(untracked, nullptr);

  // No tag: the memory still goes back, and the firmware's status is all.
  EXPECT_EQ(nimb::TrackedFree(untracked), EFI_SUCCESS);
  EXPECT_EQ(Length(gMemoryTags), 1u);

  // Refused by the firmware: the tag stays.
  fw.FailCall("FreePool", 1, EFI_INVALID_PARAMETER);
  EXPECT_EQ(nimb::TrackedFree(tracked), EFI_INVALID_PARAMETER);
  EXPECT_EQ(Length(gMemoryTags), 1u);
  EXPECT_EQ(gMemoryTags->poolAddress, tracked);
}

TEST_F(TrackingTest, PagesAreTaggedOnlyWhenTheFirmwareGivesThem) {
  EFI_PHYSICAL_ADDRESS address = 0x200000;
  ASSERT_EQ(nimb::TrackedAllocatePages(AllocateAddress, EfiLoaderData, 4, &address), EFI_SUCCESS);
  EXPECT_EQ(address, 0x200000u);
  ASSERT_EQ(Length(gMemoryTags), 1u);
  EXPECT_EQ(gMemoryTags->poolAddress, nullptr);
  EXPECT_EQ(gMemoryTags->pageCount, 4u);
  EXPECT_EQ(gMemoryTags->pageAddress, 0x200000u);

  fw.FailAllocation(1);
  EFI_PHYSICAL_ADDRESS other = 0;
  EXPECT_EQ(nimb::TrackedAllocatePages(AllocateAnyPages, EfiLoaderData, 1, &other), EFI_OUT_OF_RESOURCES);
  fw.FailAllocation(1);
  EXPECT_EQ(nimb::TrackedAllocatePool(8), nullptr);
  EXPECT_EQ(Length(gMemoryTags), 1u);

  // TrackPool takes in what the firmware handed out elsewhere.
  void *foreign = nimb::AllocatePool(32);
  MemoryTag *tag = nimb::TrackPool(foreign);
  EXPECT_EQ(tag, gMemoryTags);
  EXPECT_EQ(tag->poolAddress, foreign);

  nimb::TrackedFreeAll();
  ExpectNothingHeld();
}

// Hundreds of live tags freed in any order (past a long walk, through the
// index): the live ones stay tagged, and all goes back.
TEST_F(TrackingTest, ManyFreesInAnyOrder) {
  for (bool withPages : {false, true}) {
    std::vector<void *> buffers;
    for (int i = 0; i < 1600; i++) {
      buffers.push_back(nimb::TrackedAllocatePool(8));
      EFI_PHYSICAL_ADDRESS pages = 0;
      if (withPages && i % 400 == 200)
        ASSERT_EQ(nimb::TrackedAllocatePages(AllocateAnyPages, EfiLoaderData, 1, &pages), EFI_SUCCESS);
    }
    // Oldest first, then every other from the newest, then the rest shuffled.
    std::vector<void *> order(buffers.begin(), buffers.begin() + 300);
    for (size_t i = buffers.size() - 1; i >= 300; i -= 2)
      order.push_back(buffers[i]);
    std::vector<void *> rest;
    for (size_t i = buffers.size() - 2; i >= 300; i -= 2)
      rest.push_back(buffers[i]);
    std::shuffle(rest.begin(), rest.end(), std::mt19937(7));
    order.insert(order.end(), rest.begin(), rest.end());
    std::multiset<void *> live(buffers.begin(), buffers.end());
    void *untracked = nimb::AllocatePool(8);
    for (size_t n = 0; n < order.size(); n++) {
      ASSERT_EQ(nimb::TrackedFree(order[n]), EFI_SUCCESS);
      live.erase(order[n]);
      if (n == 200)
        EXPECT_EQ(nimb::TrackedFree(untracked), EFI_SUCCESS);
      if (n % 16 != 0)
        continue;
      std::multiset<void *> tagged;
      for (const MemoryTag *tag = gMemoryTags; tag != nullptr; tag = tag->next)
        if (tag->poolAddress != nullptr)
          tagged.insert(tag->poolAddress);
      ASSERT_EQ(tagged, live) << withPages << " after " << n;
    }
    EXPECT_EQ(Length(gMemoryTags), withPages ? 4u : 0u);
    // Nothing but the tag blocks when no tag is left.
    if (!withPages)
      EXPECT_EQ(fw.LivePoolBlocks(), Length(gMemoryTagBlocks));
    nimb::TrackedFreeAll();
    ExpectNothingHeld();
  }
}

TEST_F(TrackingTest, ARefusedBufferLeavesNoTagAndNoBlockIsFatal) {
  // The buffer's pool is the first call, the tag block's the second.
  fw.FailCall("AllocatePool");
  EXPECT_EQ(nimb::TrackedAllocatePool(8), nullptr);
  EXPECT_EQ(gMemoryTags, nullptr);
  EXPECT_EQ(gMemoryTagBlocks, nullptr);

  fw.FailCall("AllocatePool", 2);
  hostfw::RunResult result = fw.Call([] { nimb::TrackedAllocatePool(8); });
  EXPECT_EQ(result.end, hostfw::RunEnd::Exited);
  EXPECT_EQ(result.status, EFI_ABORTED);
  EXPECT_EQ(fw.ConOutText(), "Can't allocate memory tag");
}

}  // namespace
