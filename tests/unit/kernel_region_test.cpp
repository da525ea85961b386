// The kernel region's allocator (the ranges it announces are read by the drivers' and
// boot screen's tests).
#include "memory/kernel_region.h"

#include <gtest/gtest.h>

#include <cstring>
#include <vector>

#include "loader_fixture.h"

namespace {

using Bytes = std::vector<uint8_t>;

class KernelRegionTest : public nimbtest::LoaderTest {};

TEST_F(KernelRegionTest, AllocationsAtTheTopRoundToPagesAndRaiseIt) {
  struct Row {
    const char *what;
    UINT64 top;
    UINT64 size;
    const char *failCall;  // a service refused once, or null
    UINT64 taken;          // pages already allocated at the top, or 0
    UINT64 result;
    UINT64 sizeAfter;
    UINT64 topAfter;
    const char *message;
  };
  const Row rows[] = {
      {"0x1001 bytes", 0x200000, 0x1001, nullptr, 0, 0x200000, 0x2000, 0x202000, ""},
      {"one page", 0x300000, 0x1000, nullptr, 0, 0x300000, 0x1000, 0x301000, ""},
      {"refused", 0x200000, 0x1001, "AllocatePages", 0, 0, 0x1001, 0x200000,
       "Error allocating 0x2 pages at 0x200000 alloc type 2\r\n"},
      {"taken", 0x400000, 0x3000, nullptr, 0x402000, 0, 0x3000, 0x400000,
       "Error allocating 0x3 pages at 0x400000 alloc type 2\r\n"},
      // Pages counted without overflow, and refused.
      {"a size of 2^64 - 1", 0x200000, ~0ull, nullptr, 0, 0, ~0ull, 0x200000,
       "Error allocating 0x0 pages at 0x200000 alloc type 2\r\n"},
  };
  for (const Row &row : rows) {
    const size_t printed = fw.ConOutText().size();
    if (row.taken != 0) {
      EFI_PHYSICAL_ADDRESS taken = row.taken;
      ASSERT_EQ(nimb::TrackedAllocatePages(AllocateAddress, EfiLoaderData, 1, &taken), EFI_SUCCESS)
          << row.what;
    }
    if (row.failCall != nullptr)
      fw.FailCall(row.failCall);
    nimb::gKernelRegionTop = row.top;
    UINT64 size = row.size;
    UINT64 pagesBefore = fw.AllocatedPages();
    EXPECT_EQ(nimb::AllocateKernelRegion(&size), row.result) << row.what;
    EXPECT_EQ(size, row.sizeAfter) << row.what;
    EXPECT_EQ(nimb::gKernelRegionTop, row.topAfter) << row.what;
    EXPECT_EQ(nimb::gKernelRegionBase, 0xFFFFFFFFu) << row.what;
    EXPECT_EQ(fw.ConOutText().substr(printed), row.message) << row.what;
    if (row.result != 0) {
      EXPECT_EQ(fw.AllocatedPages() - pagesBefore, row.sizeAfter / 4096) << row.what;
      // Real memory at the address asked for, every byte of it.
      std::memset(reinterpret_cast<void *>(static_cast<uintptr_t>(row.result)), 0xA5, row.sizeAfter);
    }
    nimb::TrackedFreeAll();
    EXPECT_EQ(fw.AllocatedPages(), 0u) << row.what;
  }
}

}  // namespace
