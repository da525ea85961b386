// The device tree: pooled records, path lookup, and the flattened bytes.
#include "devicetree/devicetree.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <string>
#include <vector>

#include "loader_fixture.h"

namespace {

using nimb::DeviceTreeAddChild;
using nimb::DeviceTreeAddProperty;
using nimb::DeviceTreeFindNode;
using nimb::DeviceTreeFindProperty;
using nimb::DeviceTreeNode;
using nimb::DeviceTreeProperty;
using Bytes = std::vector<uint8_t>;

// --- the expected flattened form, built from the format ---------------------

void Put32(Bytes &out, uint32_t value) {
  for (int i = 0; i < 4; i++)
    out.push_back(static_cast<uint8_t>(value >> (8 * i)));
}

Bytes Text(const std::string &text) {
  Bytes bytes(text.begin(), text.end());
  bytes.push_back(0);
  return bytes;
}

// A property image; value bytes past `value` (or all, for an empty one) are
// zero.
Bytes PropertyImage(const std::string &name, uint32_t length, const Bytes &value = {}) {
  Bytes out(32, 0);
  std::memcpy(out.data(), name.data(), std::min<size_t>(name.size(), 31));
  Put32(out, length);
  Bytes body((length + 3) & ~3u, 0);
  std::copy(value.begin(), value.end(), body.begin());
  out.insert(out.end(), body.begin(), body.end());
  return out;
}

Bytes Property(const std::string &name, const Bytes &value) {
  return PropertyImage(name, static_cast<uint32_t>(value.size()), value);
}

Bytes NameProperty(const std::string &name) {
  return Property("name", Text(name));
}

Bytes NodeImage(const std::vector<Bytes> &properties, const std::vector<Bytes> &children) {
  Bytes out;
  Put32(out, static_cast<uint32_t>(properties.size()));
  Put32(out, static_cast<uint32_t>(children.size()));
  for (const Bytes &p : properties)
    out.insert(out.end(), p.begin(), p.end());
  for (const Bytes &c : children)
    out.insert(out.end(), c.begin(), c.end());
  return out;
}

class DeviceTreeTest : public nimbtest::LoaderTest {
 protected:
  void SetUp() override {
    LoaderTest::SetUp();
    root = nimb::DeviceTreeInit();
    ASSERT_NE(root, nullptr);
  }

  // The two-pass use: the size first, then the image into a caller's buffer
  // whose bytes are not zero, with guard bytes behind it.
  Bytes Flatten() {
    UINT64 size = 0;
    nimb::DeviceTreeFlatten(nullptr, &size);
    Bytes area(size + 16, 0xEE);
    UINT64 address = reinterpret_cast<UINTN>(area.data());
    UINT64 written = 0;
    nimb::DeviceTreeFlatten(&address, &written);
    EXPECT_EQ(written, size);
    EXPECT_EQ(address, reinterpret_cast<UINTN>(area.data()));
    EXPECT_EQ(Bytes(area.begin() + size, area.end()), Bytes(16, 0xEE)) << "written past the size";
    area.resize(size);
    return area;
  }

  std::string NameOf(DeviceTreeNode *node) {
    DeviceTreeProperty *name = DeviceTreeFindProperty(node, "name");
    return name == nullptr ? "(no name)" : static_cast<const char *>(name->value);
  }

  DeviceTreeNode *root = nullptr;
};

TEST_F(DeviceTreeTest, PropertyImagesTakeTheirPaddedLength) {
  static const char kAcpi[] = "ACPI";
  static const uint8_t kEight[] = {1, 2, 3, 4, 5, 6, 7, 8};
  struct Row {
    const char *name;
    uint64_t length;
    const void *value;
  };
  const Row rows[] = {
      {"five", 5, kAcpi},
      {"eight", 8, kEight},
      {"empty", 0, kAcpi},
      {"null-twelve", 12, nullptr},
      {"low-32-bits", 0x100000003ull, kAcpi},
  };
  for (const Row &row : rows) {
    root = nimb::DeviceTreeInit();
    uint32_t length = static_cast<uint32_t>(row.length);
    ASSERT_NE(DeviceTreeAddProperty(root, row.name, row.length, row.value, 0), nullptr) << row.name;
    Bytes value;
    if (row.value != nullptr)
      value.assign(static_cast<const uint8_t *>(row.value), static_cast<const uint8_t *>(row.value) + length);
    EXPECT_EQ(Flatten(), NodeImage({NameProperty("/"), PropertyImage(row.name, length, value)}, {}))
        << row.name;
  }
}

TEST_F(DeviceTreeTest, ACopyIsTakenAtTheCallAndAKeptValueIsReadAtTheFlattening) {
  char copied[] = "old";
  char kept[] = "old";
  DeviceTreeAddProperty(root, "copied", 4, copied, 1);
  DeviceTreeAddProperty(root, "kept", 4, kept, 0);
  std::strcpy(copied, "new");
  std::strcpy(kept, "new");
  EXPECT_EQ(
      Flatten(),
      NodeImage({NameProperty("/"), Property("copied", Text("old")), Property("kept", Text("new"))}, {}));
}

// FindProperty gives the first of two of a name; both are flattened.
TEST_F(DeviceTreeTest, PropertiesKeepTheirOrderAndChildrenComeOutNewestFirst) {
  std::vector<DeviceTreeProperty *> added;
  for (const char *name : {"pa", "pb", "pb"})
    added.push_back(DeviceTreeAddProperty(root, name, 2, "x", 0));
  EXPECT_EQ(DeviceTreeFindProperty(root, "pb"), added[1]);
  EXPECT_EQ(DeviceTreeFindProperty(root, "p"), nullptr);
  DeviceTreeNode *a = DeviceTreeFindNode("/a/x", 1);
  ASSERT_NE(a, nullptr);
  DeviceTreeAddProperty(a, "leaf", 4, "abc", 0);
  DeviceTreeAddChild(root, "b");
  DeviceTreeAddChild(root, "c");

  Bytes x = NodeImage({NameProperty("x"), Property("leaf", Text("abc"))}, {});
  Bytes expected = NodeImage(
      {NameProperty("/"), Property("pa", Text("x")), Property("pb", Text("x")), Property("pb", Text("x"))},
      {NodeImage({NameProperty("c")}, {}), NodeImage({NameProperty("b")}, {}),
       NodeImage({NameProperty("a")}, {x})});
  EXPECT_EQ(Flatten(), expected);
  EXPECT_EQ(expected.size(), 400u);
  EXPECT_EQ(NodeImage({NameProperty("/")}, {}).size(), 48u);
}

TEST_F(DeviceTreeTest, FindNodeWalksComponentsOfAtMost30Characters) {
  const std::string thirty(30, 't');
  const std::string thirtyFive = std::string(30, 'f') + "fffff";
  struct Row {
    std::string path;
    uint8_t create;
    std::string sameAs;  // a path naming the expected node; empty: null
    unsigned added;      // nodes made by the call
  };
  const Row rows[] = {
      {"/a/b", 1, "/a/b", 2},
      {"/a/b", 1, "/a/b", 0},
      {"//a///b/", 0, "/a/b", 0},
      {"/a/c", 0, "", 0},
      {"", 1, "/", 0},
      {"/" + thirty + "/y", 1, "/" + thirty + "/y", 2},
      {"/" + thirty, 0, "/" + thirty + "/", 0},
      {"/" + thirtyFive, 1, "/" + std::string(30, 'f') + "/fffff", 2},
      {"/" + thirtyFive + "/g", 0, "", 0},
      {"/" + thirtyFive + "/g", 1, "/" + std::string(30, 'f') + "/fffff/g", 1},
  };
  for (const Row &row : rows) {
    UINT32 before = nimb::gDeviceTreeNodeCount;
    DeviceTreeNode *found = DeviceTreeFindNode(row.path.c_str(), row.create);
    EXPECT_EQ(nimb::gDeviceTreeNodeCount - before, row.added) << row.path;
    if (row.sameAs.empty())
      EXPECT_EQ(found, nullptr) << row.path;
    else
      EXPECT_EQ(found, DeviceTreeFindNode(row.sameAs.c_str(), 0)) << row.path;
  }
  EXPECT_EQ(DeviceTreeFindNode("/", 0), root);
  DeviceTreeNode *cut = DeviceTreeFindNode(("/" + thirtyFive).c_str(), 0);
  EXPECT_EQ(NameOf(cut), "fffff");
  EXPECT_EQ(NameOf(DeviceTreeFindNode(("/" + thirty).c_str(), 0)), thirty);
}

// Nodes nested deeper than the writer goes are left out: the node at the
// limit is written without children, and nothing lands past the size.
TEST_F(DeviceTreeTest, FlatteningStopsAtTheDepthLimit) {
  std::string path;
  for (size_t i = 0; i < nimb::kDeviceTreeMaxDepth + 6; i++)
    path += "/d";
  ASSERT_NE(DeviceTreeFindNode(path.c_str(), 1), nullptr);
  Bytes flat = Flatten();
  const Bytes link = NodeImage({NameProperty("d")}, {});
  size_t at = 48;
  for (size_t depth = 1; depth <= nimb::kDeviceTreeMaxDepth; depth++, at += link.size()) {
    ASSERT_EQ(flat[at], 1u) << depth;
    ASSERT_EQ(flat[at + 4], depth < nimb::kDeviceTreeMaxDepth ? 1u : 0u) << depth;
    ASSERT_EQ(Bytes(flat.begin() + at + 8, flat.begin() + at + link.size()), NameProperty("d")) << depth;
  }
  EXPECT_EQ(Bytes(flat.begin() + at, flat.end()), Bytes(6 * link.size(), 0));
}

TEST_F(DeviceTreeTest, ANameLongerThan31CharactersIsCutInsideItsField) {
  const std::string longName(40, 'L');
  DeviceTreeAddProperty(root, longName.c_str(), 4, "abc", 0);
  const std::string exact(31, 'E');
  DeviceTreeAddProperty(root, exact.c_str(), 4, "xyz", 0);
  // The field keeps 31 characters and a NUL; the length word stays intact.
  EXPECT_EQ(Flatten(), NodeImage({NameProperty("/"), Property(std::string(31, 'L'), Text("abc")),
                                  Property(exact, Text("xyz"))},
                                 {}));
}

}  // namespace
