// Device path walks: where they end, where they stop on damaged paths, and
// copies made through the firmware.
#include "support/devicepath.h"

#include <gtest/gtest.h>

#include <cstring>
#include <string>
#include <vector>

#include "loader_fixture.h"

namespace {

using Bytes = std::vector<UINT8>;

const EFI_DEVICE_PATH_PROTOCOL *AsPath(const Bytes &bytes) {
  return reinterpret_cast<const EFI_DEVICE_PATH_PROTOCOL *>(bytes.data());
}

Bytes Cat(std::initializer_list<Bytes> parts) {
  Bytes out;
  for (const Bytes &part : parts)
    out.insert(out.end(), part.begin(), part.end());
  return out;
}

// A node of `length` bytes, its data filled with `fill`.
Bytes Node(UINT8 type, UINT8 subType, UINT16 length, UINT8 fill = 0xAA) {
  Bytes node = {type, subType, static_cast<UINT8>(length), static_cast<UINT8>(length >> 8)};
  if (length > 4)
    node.resize(length, fill);
  return node;
}

const Bytes kEnd = {0x7F, 0xFF, 0x04, 0x00};
constexpr size_t kWholeBuffer = static_cast<size_t>(-1);

TEST(DevicePathTest, WalksVisitEveryNodeAndStopAtTheEndOrAtADamagedNode) {
  struct Row {
    const char *name;
    Bytes bytes;
    size_t bound;                 // kWholeBuffer: the buffer's size
    std::vector<size_t> visited;  // offsets of the nodes in front of the end
    size_t size;                  // DevicePathSizeWithin; 0 for a damaged path
  };
  const Row rows[] = {
      {"end node only", kEnd, kWholeBuffer, {}, 4},
      {"end node of length 0", {0x7F, 0xFF, 0x00, 0x00}, kWholeBuffer, {}, 4},
      {"two nodes", Cat({Node(1, 1, 6), Node(4, 4, 10), kEnd}), kWholeBuffer, {0, 6}, 20},
      {"end of instance is stepped over",
       Cat({Node(1, 1, 4), Node(0x7F, 0x01, 4), Node(3, 11, 8), kEnd}),
       kWholeBuffer,
       {0, 4, 8},
       20},
      {"0xFF/0x01 is no end", Cat({Node(0xFF, 0x01, 4), kEnd}), kWholeBuffer, {0}, 8},
      {"length is little-endian", Cat({Node(4, 4, 0x0104), kEnd}), kWholeBuffer, {0}, 0x108},
      {"bound ends exactly behind the end node", Cat({Node(1, 1, 6), kEnd, Bytes(8, 0)}), 10, {0}, 10},
      {"node of length 0", Cat({Node(1, 1, 6), Node(1, 1, 0), kEnd}), kWholeBuffer, {0}, 0},
      {"node of length 3", Cat({Node(1, 1, 3), Bytes(1, 0), kEnd}), kWholeBuffer, {}, 0},
      {"first node one byte past the buffer", Cat({Node(1, 1, 8)}), 7, {}, 0},
      {"node runs past the buffer", Cat({Node(1, 1, 4), Node(4, 4, 0x100)}), 40, {0}, 0},
      {"end node cut short", Cat({Node(1, 1, 4), Bytes{0x7F, 0xFF}}), kWholeBuffer, {0}, 0},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(row.name);
    // An exact heap copy, so that a read past the bound is caught.
    const size_t bound = row.bound == kWholeBuffer ? row.bytes.size() : row.bound;
    std::vector<UINT8> copy(row.bytes.begin(), row.bytes.begin() + bound);
    const EFI_DEVICE_PATH_PROTOCOL *path = copy.empty() ? AsPath(row.bytes) : AsPath(copy);

    std::vector<size_t> visited;
    UINTN remaining = bound;
    const EFI_DEVICE_PATH_PROTOCOL *node = nimb::DevicePathFirstNode(path, &remaining);
    for (; node != nullptr && !nimb::IsDevicePathEnd(node);
         node = nimb::DevicePathNextNode(node, &remaining)) {
      const size_t offset = reinterpret_cast<const UINT8 *>(node) - reinterpret_cast<const UINT8 *>(path);
      EXPECT_EQ(remaining, bound - offset);
      visited.push_back(offset);
    }
    EXPECT_EQ(visited, row.visited);
    EXPECT_EQ(node == nullptr, row.size == 0);
    if (node != nullptr) {
      EXPECT_EQ(nimb::DevicePathNextNode(node, &remaining), nullptr) << "nothing follows the end";
    }
    EXPECT_EQ(nimb::DevicePathSizeWithin(path, bound), row.size);
    if (row.bound == kWholeBuffer && row.size != 0) {
      EXPECT_EQ(nimb::DevicePathSize(path), row.size);
    }
  }
}

TEST(DevicePathTest, FindNodeTakesTheFirstMatchInFrontOfTheEnd) {
  // Firmware paths are bounded by the largest path size: nothing damaged in
  // this one, but no end within the bound.
  Bytes bytes;
  while (bytes.size() < nimb::kMaxDevicePathSize + 8) {
    const Bytes node = Node(4, 4, 0x1000);
    bytes.insert(bytes.end(), node.begin(), node.end());
  }
  bytes.insert(bytes.end(), kEnd.begin(), kEnd.end());
  EXPECT_EQ(nimb::DevicePathSize(AsPath(bytes)), 0u);
  EXPECT_EQ(nimb::DevicePathSizeWithin(AsPath(bytes), bytes.size()), bytes.size());

  const Bytes path = Cat({Node(2, 1, 12), Node(0x83, 11, 10), Node(0x7F, 0x01, 4), Node(4, 1, 42),
                          Node(4, 4, 8), Node(4, 1, 42), kEnd, Node(5, 1, 4)});
  struct Row {
    UINT8 type;
    UINT8 subType;
    size_t bound;   // kWholeBuffer: the buffer's size
    size_t offset;  // kWholeBuffer: not found
  };
  const Row rows[] = {
      {2, 1, kWholeBuffer, 0},
      {3, 11, kWholeBuffer, 12},           // bit 7 of the type does not count
      {4, 1, kWholeBuffer, 26},            // the first of two
      {5, 1, kWholeBuffer, kWholeBuffer},  // behind the end
      {4, 4, 70, kWholeBuffer},            // the file node runs past the bound
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(std::to_string(row.type) + "/" + std::to_string(row.subType));
    const size_t bound = row.bound == kWholeBuffer ? path.size() : row.bound;
    const EFI_DEVICE_PATH_PROTOCOL *node =
        nimb::DevicePathFindNode(AsPath(path), bound, row.type, row.subType);
    if (row.offset == kWholeBuffer) {
      EXPECT_EQ(node, nullptr);
    } else {
      EXPECT_EQ(reinterpret_cast<const UINT8 *>(node), path.data() + row.offset);
    }
  }
  const Bytes damaged = Cat({Node(1, 1, 0), Node(3, 11, 10), kEnd});
  EXPECT_EQ(nimb::DevicePathFindNode(AsPath(damaged), damaged.size(), 3, 11), nullptr);
  EXPECT_EQ(nimb::DevicePathFindNode(nullptr, 100, 3, 11), nullptr);
  EXPECT_EQ(nimb::DevicePathSize(nullptr), 0u);
}

class DevicePathFirmwareTest : public nimbtest::LoaderTest {};

TEST_F(DevicePathFirmwareTest, DuplicateMakesAnUntrackedCopyOfTheWholePathOrNone) {
  const Bytes path = Cat({Node(2, 1, 12, 0x11), Node(4, 4, 10, 0x22), kEnd, Node(1, 1, 4)});
  const unsigned copies = fw.CallCount("CopyMem");
  EFI_DEVICE_PATH_PROTOCOL *copy = nimb::DuplicateDevicePath(AsPath(path));
  ASSERT_NE(copy, nullptr);
  EXPECT_EQ(Bytes(reinterpret_cast<UINT8 *>(copy), reinterpret_cast<UINT8 *>(copy) + 26),
            Bytes(path.begin(), path.begin() + 26));
  EXPECT_EQ(fw.CallCount("CopyMem"), copies + 1);
  EXPECT_EQ(nimb::gMemoryTags, nullptr);
  EXPECT_EQ(fw.LivePoolBlocks(), 1u);
  ASSERT_EQ(nimb::gBS->FreePool(copy), EFI_SUCCESS);

  // No copy of a null or damaged path, nor without memory.
  const Bytes damaged = Cat({Node(1, 1, 0), kEnd});
  const unsigned allocations = fw.AllocatePoolCalls();
  EXPECT_EQ(nimb::DuplicateDevicePath(nullptr), nullptr);
  EXPECT_EQ(nimb::DuplicateDevicePath(AsPath(damaged)), nullptr);
  EXPECT_EQ(fw.AllocatePoolCalls(), allocations);
  fw.FailAllocation(1);
  EXPECT_EQ(nimb::DuplicateDevicePath(AsPath(kEnd)), nullptr);
  fw.FailAllocation(1);
  EXPECT_EQ(nimb::AllocateCopyPool(4, "abc"), nullptr);
  ExpectNothingHeld();
}

}  // namespace
