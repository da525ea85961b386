// The kernel region's allocators and the ranges announced in the device tree.
#include "memory/kernel_region.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <string>
#include <vector>

#include "devicetree/devicetree.h"
#include "loader_fixture.h"

namespace {

using Bytes = std::vector<uint8_t>;

class KernelRegionTest : public nimbtest::LoaderTest {
 protected:
  Bytes Flatten() {
    UINT64 size = 0;
    nimb::DeviceTreeFlatten(nullptr, &size);
    Bytes area(size, 0xEE);
    UINT64 address = reinterpret_cast<UINTN>(area.data());
    nimb::DeviceTreeFlatten(&address, &size);
    return area;
  }

  // The 12 bytes behind the name field of the property image named `name`
  // (its length word and 8 value bytes), or nothing.
  static Bytes RangeImage(const Bytes &flat, const std::string &name) {
    Bytes field(32, 0);
    std::memcpy(field.data(), name.data(), name.size());
    auto at = std::search(flat.begin(), flat.end(), field.begin(), field.end());
    if (at == flat.end() || flat.end() - at < 44)
      return {};
    return Bytes(at + 32, at + 44);
  }
};

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

TEST_F(KernelRegionTest, RangesEnterTheLow32BitsOfAddressAndLength) {
  ASSERT_NE(nimb::DeviceTreeInit(), nullptr);
  nimb::gMemoryMapNode = nimb::DeviceTreeFindNode("/chosen/memory-map", 1);
  ASSERT_NE(nimb::gMemoryMapNode, nullptr);
  const std::string drivers = "DriversPackage-" + std::string("fedcba9876543210");
  ASSERT_EQ(drivers.size(), 31u);
  struct Row {
    std::string name;
    UINT64 address;
    UINT64 length;
    UINT32 type;
    Bytes value;  // the low words of address and length
  };
  const Row rows[] = {
      {"BootCLUT", 0x1234000, 0x300, 0, {0x00, 0x40, 0x23, 0x01, 0x00, 0x03, 0, 0}},
      {"Above4G", 0x123456000ull, 0x100001000ull, 1, {0x00, 0x60, 0x45, 0x23, 0x00, 0x10, 0x00, 0x00}},
      {drivers, 0xFFFFFFFFFFFFF000ull, 0xFFFFFFFF, 2, {0x00, 0xF0, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF}},
  };
  for (const Row &row : rows) {
    // The caller's text may go once the call returns.
    std::vector<char> name(row.name.begin(), row.name.end());
    name.push_back('\0');
    EXPECT_EQ(nimb::AddMemoryRange(name.data(), row.address, row.length, row.type), EFI_SUCCESS) << row.name;
    std::fill(name.begin(), name.end(), 'X');
  }
  Bytes flat = Flatten();
  for (const Row &row : rows) {
    Bytes image = {8, 0, 0, 0};  // the length word
    image.insert(image.end(), row.value.begin(), row.value.end());
    EXPECT_EQ(RangeImage(flat, row.name), image) << row.name;
  }
  // The longest name is whole, with its NUL as the field's last byte.
  auto field = std::search(flat.begin(), flat.end(), drivers.begin(), drivers.end());
  ASSERT_NE(field, flat.end());
  EXPECT_EQ(field[31], 0);
  EXPECT_EQ(nimb::gDeviceTreePropertyCount, 3u + 3u);
}

}  // namespace
