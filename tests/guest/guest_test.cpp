// The reference kernel's walkers and checks, compiled for the host: fed a
// hand-built flattened tree, boot record and memory map at fake physical
// addresses, and judged by the report they print.
#include <gtest/gtest.h>

#include <algorithm>
#include <cstdio>
#include <cstring>
#include <functional>
#include <regex>
#include <set>
#include <sstream>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

#include "boot/bootinfo.h"
#include "bootargs.h"
#include "checks.h"
#include "devicetree.h"
#include "drivers.h"
#include "entry.h"
#include "hold.h"
#include "memory.h"
#include "report.h"
#include "resume_probe.h"

namespace g = nimb::guest;

// --- the kernel's record is the loader's ------------------------------------------

#define SAME_FIELD(field) \
  static_assert(offsetof(nimb::BootArgs, field) == offsetof(g::BootArgs, field), #field " moved")
SAME_FIELD(revision);
SAME_FIELD(version);
SAME_FIELD(commandLine);
SAME_FIELD(memoryMap);
SAME_FIELD(memoryMapSize);
SAME_FIELD(memoryDescriptorSize);
SAME_FIELD(memoryDescriptorVersion);
SAME_FIELD(videoBaseAddress);
SAME_FIELD(videoDisplayMode);
SAME_FIELD(videoRowBytes);
SAME_FIELD(videoWidth);
SAME_FIELD(videoHeight);
SAME_FIELD(videoDepth);
SAME_FIELD(deviceTree);
SAME_FIELD(deviceTreeLength);
SAME_FIELD(kernelRegionBase);
SAME_FIELD(kernelRegionSize);
SAME_FIELD(runtimePageStart);
SAME_FIELD(runtimePageCount);
SAME_FIELD(systemTable);
SAME_FIELD(firmwareBits);
SAME_FIELD(reserved);
static_assert(sizeof(nimb::BootArgs) == sizeof(g::BootArgs));
static_assert(nimb::kBootArgsRevision == g::kBootArgsRevision &&
              nimb::kBootArgsVersion == g::kBootArgsVersion && nimb::kFirmwareBits == g::kFirmwareBits);
static_assert(offsetof(EFI_SYSTEM_TABLE, RuntimeServices) == g::kSystemTableRuntimeServices);
static_assert(offsetof(EFI_SYSTEM_TABLE, BootServices) == g::kSystemTableBootServices);
static_assert(offsetof(EFI_SYSTEM_TABLE, NumberOfTableEntries) == g::kSystemTableNumberOfTableEntries);
static_assert(offsetof(EFI_SYSTEM_TABLE, ConfigurationTable) == g::kSystemTableConfigurationTable);
static_assert(sizeof(EFI_SYSTEM_TABLE) == g::kSystemTableSize);
#undef SAME_FIELD

// --- the kernel's two seams: output and memory ---------------------------------------

namespace {

std::string gOutput;

// Fake physical memory: [kMemoryBase, kMemoryBase + kMemorySize).
constexpr uint32_t kMemoryBase = 0x100000;
constexpr uint32_t kMemorySize = 0x200000;
std::vector<uint8_t> gMemory(kMemorySize);

uint8_t *At(uint32_t address) {
  return gMemory.data() + (address - kMemoryBase);
}

}  // namespace

namespace nimb::guest {

void ReportOutput(char character) {
  gOutput.push_back(character);
}

const uint8_t *GuestMemory(uint32_t address, uint32_t length) {
  if (address < kMemoryBase || address - kMemoryBase > kMemorySize ||
      length > kMemorySize - (address - kMemoryBase)) {
    return nullptr;
  }
  return At(address);
}

}  // namespace nimb::guest

namespace {

using Bytes = std::vector<uint8_t>;

std::string Capture(const std::function<void()> &print) {
  gOutput.clear();
  print();
  return gOutput;
}

void Put32(Bytes &out, uint32_t value) {
  for (int i = 0; i < 4; i++) {
    out.push_back(static_cast<uint8_t>(value >> (8 * i)));
  }
}

void Put64(Bytes &out, uint64_t value) {
  Put32(out, static_cast<uint32_t>(value));
  Put32(out, static_cast<uint32_t>(value >> 32));
}

Bytes Text(const std::string &text) {
  Bytes bytes(text.begin(), text.end());
  bytes.push_back(0);
  return bytes;
}

Bytes Words(std::initializer_list<uint32_t> words) {
  Bytes bytes;
  for (uint32_t word : words) {
    Put32(bytes, word);
  }
  return bytes;
}

// --- flattened trees, built from the format -----------------------------------------

Bytes PropertyImage(const std::string &name, const Bytes &value) {
  Bytes out(32, 0);
  std::memcpy(out.data(), name.data(), std::min<size_t>(name.size(), 32));
  Put32(out, static_cast<uint32_t>(value.size()));
  out.insert(out.end(), value.begin(), value.end());
  out.resize(out.size() + (4 - value.size() % 4) % 4, 0);
  return out;
}

struct Node {
  std::string name;
  std::vector<std::pair<std::string, Bytes>> properties;  // behind "name"
  std::vector<Node> children;
  bool named = true;  // give it a "name" property in front

  Node &Add(const std::string &key, const Bytes &value) {
    properties.emplace_back(key, value);
    return *this;
  }
  Node &Child(const std::string &childName) {
    children.push_back(Node{childName, {}, {}});
    return children.back();
  }
  Node *Find(const std::string &path) {
    Node *node = this;
    std::stringstream parts(path);
    std::string part;
    while (std::getline(parts, part, '/')) {
      if (part.empty()) {
        continue;
      }
      Node *next = nullptr;
      for (Node &child : node->children) {
        if (child.name == part) {
          next = &child;
        }
      }
      if (next == nullptr) {
        return nullptr;
      }
      node = next;
    }
    return node;
  }
  Bytes *Property(const std::string &key) {
    for (auto &property : properties) {
      if (property.first == key) {
        return &property.second;
      }
    }
    return nullptr;
  }
  void Remove(const std::string &key) {
    for (auto it = properties.begin(); it != properties.end(); ++it) {
      if (it->first == key) {
        properties.erase(it);
        return;
      }
    }
  }
};

Bytes Flatten(const Node &node) {
  Bytes out;
  Put32(out, static_cast<uint32_t>(node.properties.size() + (node.named ? 1 : 0)));
  Put32(out, static_cast<uint32_t>(node.children.size()));
  if (node.named) {
    Bytes name = PropertyImage("name", Text(node.name));
    out.insert(out.end(), name.begin(), name.end());
  }
  for (const auto &property : node.properties) {
    Bytes image = PropertyImage(property.first, property.second);
    out.insert(out.end(), image.begin(), image.end());
  }
  for (const Node &child : node.children) {
    Bytes image = Flatten(child);
    out.insert(out.end(), image.begin(), image.end());
  }
  return out;
}

// A device path of one hardware node and the end node.
Bytes DevicePath() {
  return Bytes{0x01, 0x01, 0x06, 0x00, 0x00, 0x1F, 0x7F, 0xFF, 0x04, 0x00};
}

// --- the walker ------------------------------------------------------------------------

g::TreeWalkResult Walk(const Bytes &tree, std::vector<std::string> *paths = nullptr) {
  // An exact copy on the heap, so that a read past its end is caught.
  std::vector<uint8_t> copy(tree);
  g::TreeVisitor visitor{nullptr, nullptr};
  if (paths != nullptr) {
    visitor.node = [](void *context, const g::TreeNode &node) {
      static_cast<std::vector<std::string> *>(context)->push_back(node.path);
    };
    visitor.property = [](void *context, const g::TreeNode &, const g::TreeProperty &property) {
      static_cast<std::vector<std::string> *>(context)->push_back(std::string("  ") + property.name);
    };
  }
  return g::TreeWalk(copy.empty() ? nullptr : copy.data(), static_cast<uint32_t>(copy.size()), visitor,
                     paths);
}

Node SmallTree() {
  Node root{"/", {}, {}};
  root.Add("compatible", Text("ACPI"));
  root.Child("efi").Child("platform").Add("value", Bytes{1, 2, 3});
  root.Child("chosen").Add("boot-args", Text("-v"));
  return root;
}

Node Chain(int depth) {
  Node root{"/", {}, {}};
  Node *node = &root;
  for (int i = 1; i < depth; i++) {
    node = &node->Child("n");
  }
  return root;
}

TEST(GuestTreeWalk, FollowsNodesAndPropertiesInOrder) {
  std::vector<std::string> seen;
  g::TreeWalkResult result = Walk(Flatten(SmallTree()), &seen);
  EXPECT_EQ(result.status, g::kTreeOk);
  EXPECT_EQ(result.nodes, 4u);
  EXPECT_EQ(result.properties, 7u);
  std::vector<std::string> wanted = {"/",       "  name",        "  compatible", "/efi",
                                     "  name",  "/efi/platform", "  name",       "  value",
                                     "/chosen", "  name",        "  boot-args"};
  EXPECT_EQ(seen, wanted);
}

TEST(GuestTreeWalk, RefusesMalformedTrees) {
  Bytes good = Flatten(SmallTree());
  Bytes unterminated = good;
  std::memset(unterminated.data() + 8, 'x', 32);  // the root's "name" field
  Bytes hugeValue = PropertyImage("p", {});
  hugeValue[32] = hugeValue[33] = hugeValue[34] = hugeValue[35] = 0xFF;
  Bytes paddingWraps = hugeValue;
  paddingWraps[32] = 0xFD;
  Bytes oneTooLong = PropertyImage("p", Bytes{1, 2, 3, 4});
  oneTooLong[32] = 5;  // padded to 8 bytes, with 4 in the buffer
  auto rootWith = [](const Bytes &property, uint32_t count, uint32_t children) {
    Bytes out = Words({count, children});
    out.insert(out.end(), property.begin(), property.end());
    return out;
  };
  Bytes trailing = good;
  Put32(trailing, 0);
  struct Row {
    const char *name;
    Bytes tree;
    g::TreeStatus status;
  } rows[] = {
      {"well formed", good, g::kTreeOk},
      {"empty", {}, g::kTreeTruncated},
      {"header cut", Bytes{1, 0, 0, 0, 0, 0}, g::kTreeTruncated},
      {"property promised, none there", Words({1, 0}), g::kTreeTruncated},
      {"child promised, none there", Words({0, 1}), g::kTreeTruncated},
      {"child count far too high", Words({0, 0xFFFFFFFF, 0, 0}), g::kTreeTruncated},
      {"value length 0xffffffff", rootWith(hugeValue, 1, 0), g::kTreeTruncated},
      {"value length whose padding wraps", rootWith(paddingWraps, 1, 0), g::kTreeTruncated},
      {"value one byte past the end", rootWith(oneTooLong, 1, 0), g::kTreeTruncated},
      {"name field without NUL", unterminated, g::kTreeUnterminated},
      {"bytes behind the root", trailing, g::kTreeTrailing},
      {"16 levels", Flatten(Chain(16)), g::kTreeOk},
      {"17 levels", Flatten(Chain(17)), g::kTreeTooDeep},
  };
  for (const Row &row : rows) {
    EXPECT_EQ(Walk(row.tree).status, row.status) << row.name;
  }
}

TEST(GuestTreeWalk, EveryCutOfATreeIsRefused) {
  Bytes tree = Flatten(SmallTree());
  for (size_t length = 0; length < tree.size(); length++) {
    Bytes cut(tree.begin(), tree.begin() + static_cast<long>(length));
    g::TreeWalkResult result = Walk(cut);
    EXPECT_NE(result.status, g::kTreeOk) << "cut at " << length;
    EXPECT_LE(result.offset, length) << "cut at " << length;
  }
}

TEST(GuestTreeWalk, NamesNodesByTheirFirstProperty) {
  Node root = SmallTree();
  root.Find("/efi/platform")->named = false;
  root.Find("/efi/platform")->Add("name", Text("late"));  // not first: no name
  std::vector<std::string> seen;
  ASSERT_EQ(Walk(Flatten(root), &seen).status, g::kTreeOk);
  EXPECT_NE(std::find(seen.begin(), seen.end(), "/efi/(null)"), seen.end());

  Bytes tree = Flatten(SmallTree());
  g::TreeProperty found;
  ASSERT_TRUE(
      g::TreeFindProperty(tree.data(), static_cast<uint32_t>(tree.size()), "/chosen", "boot-args", &found));
  EXPECT_EQ(std::string(reinterpret_cast<const char *>(found.value), found.length), std::string("-v\0", 3));
  EXPECT_FALSE(
      g::TreeFindProperty(tree.data(), static_cast<uint32_t>(tree.size()), "/", "boot-args", &found));
  EXPECT_FALSE(
      g::TreeFindProperty(tree.data(), static_cast<uint32_t>(tree.size()), "/chosen/x", "name", &found));
}

// --- what the report looks like ----------------------------------------------------

TEST(GuestReport, FormatsNumbersAndTexts) {
  struct Row {
    std::function<void()> print;
    const char *expected;
  } rows[] = {
      {[] { g::Print("%08x|%x", 0x1234u, 0u); }, "00001234|0"},
      {[] { g::Print("%llx", 0x123456789abcdef0ull); }, "123456789abcdef0"},
      {[] { g::Print("%d %d %u", -5, 7, 4294967295u); }, "-5 7 4294967295"},
      {[] { g::Print("[%5u][%s][%c]", 42u, static_cast<const char *>(nullptr), 'z'); }, "[   42][(null)][z]"},
      {[] { g::Print("100%%"); }, "100%"},
      {[] { g::PrintQuoted("a\"b\\c\td\x80", 100); }, R"("a\"b\\c\x09d\x80")"},
      {[] { g::PrintQuoted("abcdef", 3); }, R"("abc")"},
  };
  for (const Row &row : rows) {
    EXPECT_EQ(Capture(row.print), row.expected);
  }
}

TEST(GuestReport, ShowsTreeValuesByTheirKind) {
  Bytes longValue;
  for (int i = 0; i < 70; i++) {
    longValue.push_back(static_cast<uint8_t>(i));
  }
  std::string longText = "<";
  for (int i = 0; i < 64; i++) {
    char hex[4];
    std::snprintf(hex, sizeof(hex), i == 0 ? "%02x" : " %02x", i);
    longText += hex;
  }
  longText += " ...> (70 bytes)";
  struct Row {
    const char *name;
    Bytes value;
    std::string expected;
  } rows[] = {
      {"text", Text("ACPI"), R"("ACPI")"},
      {"empty text", Text(""), R"("")"},
      {"text with quotes", Text("a\"b"), R"("a\"b")"},
      {"UCS-2 text", Bytes{'E', 0, 'D', 0, 'K', 0, 0, 0}, R"(u"EDK")"},
      {"one UCS-2 character is a number", Bytes{'A', 0, 0, 0}, "<41 00 00 00>"},
      {"no value", {}, "<>"},
      {"bytes", Bytes{1, 0xAB, 3}, "<01 ab 03>"},
      {"text without NUL", Bytes{'a', 'b', 'c'}, "<61 62 63>"},
      {"control byte", Bytes{'a', 1, 'b', 0}, "<61 01 62 00>"},
      {"long value", longValue, longText},
  };
  for (const Row &row : rows) {
    EXPECT_EQ(Capture([&] { g::PrintTreeValue(row.value.data(), static_cast<uint32_t>(row.value.size())); }),
              row.expected)
        << row.name;
  }
}

TEST(GuestReport, PrintsTheTreeIndented) {
  Node root = SmallTree();
  root.Find("/chosen")->Child("memory-map").Add("BootCLUT", Words({0x106000, 0x300}));
  Bytes tree = Flatten(root);
  std::string printed = Capture([&] { g::TreePrint(tree.data(), static_cast<uint32_t>(tree.size())); });
  EXPECT_EQ(printed,
            "kernel: tree / (2 properties, 2 children)\n"
            "kernel: tree   name = \"/\"\n"
            "kernel: tree   compatible = \"ACPI\"\n"
            "kernel: tree   efi/ (1 property, 1 child)\n"
            "kernel: tree     name = \"efi\"\n"
            "kernel: tree     platform/ (2 properties, 0 children)\n"
            "kernel: tree       name = \"platform\"\n"
            "kernel: tree       value = <01 02 03>\n"
            "kernel: tree   chosen/ (2 properties, 1 child)\n"
            "kernel: tree     name = \"chosen\"\n"
            "kernel: tree     boot-args = \"-v\"\n"
            "kernel: tree     memory-map/ (2 properties, 0 children)\n"
            "kernel: tree       name = \"memory-map\"\n"
            "kernel: tree       BootCLUT = <00 60 10 00 00 03 00 00> (address 0x106000, length 0x300)\n");

  tree.resize(tree.size() - 4);
  printed = Capture([&] { g::TreePrint(tree.data(), static_cast<uint32_t>(tree.size())); });
  EXPECT_NE(printed.find("kernel: tree error runs past its length at offset 0x"), std::string::npos)
      << printed;
}

// --- a whole boot ------------------------------------------------------------------------

constexpr uint32_t kEntry = 0x100000;
constexpr uint32_t kImageEnd = 0x104800;
constexpr uint32_t kBootArgsAddress = 0x105000;
constexpr uint32_t kClut = 0x106000;
constexpr uint32_t kPicture = 0x107000;
constexpr uint32_t kDriver = 0x10C000;
constexpr uint32_t kTree = 0x10D000;
constexpr uint32_t kMap = 0x10F000;
constexpr uint32_t kRuntimeStart = 0x110000;  // data, code, an I/O page, two spare pages
constexpr uint32_t kSystemTable = 0x110000;
constexpr uint32_t kRuntimeServices = 0x111000;
constexpr uint32_t kRegionEnd = 0x115000;
constexpr uint32_t kGate = 0x200000;
constexpr uint32_t kStride = 48;
constexpr uint64_t kRuntime = g::kEfiMemoryRuntime;

struct Descriptor {
  uint32_t type;
  uint64_t physical, virtualStart, pages, attribute;
};

// What a good boot hands the kernel; each row of the table below breaks one
// thing of it.
struct FakeBoot {
  g::EntryState entry{};
  g::BootArgs args{};
  // As the gate left it, and with the accessed bit that loading DS set.
  uint64_t gdt[3] = {0, 0x00CF9E000000FFFFull, 0x00CF93000000FFFFull};
  Node tree{"/", {}, {}};
  std::vector<Descriptor> map;
  uint64_t systemTableSignature = g::kSystemTableSignature;
  uint64_t runtimeServicesPointer = kRuntimeServices;
  uint64_t runtimeServicesSignature = g::kRuntimeServicesSignature;
  Bytes picture = Words({128, 128, 0});
  // The staged driver of Driver-10c000: 0x800 bytes, its code behind the text.
  Bytes driver = [] {
    Bytes text = Text("<key>VzBundleIdentifier</key><string>fake</string>");
    const uint32_t textLength = static_cast<uint32_t>(text.size());
    Bytes block = Words({kDriver + 16, textLength, kDriver + 16 + textLength, 0x800 - 16 - textLength});
    block.insert(block.end(), text.begin(), text.end());
    block.resize(0x800, 0x90);
    return block;
  }();

  FakeBoot() {
    entry.eax = entry.ebx = kBootArgsAddress;
    entry.ecx = 0xC0000080;
    entry.edi = entry.entryAddress = kEntry;
    entry.esp = 0x7FF00000;
    entry.eflags = 0x2;
    entry.cs = 0x08;
    entry.ds = entry.es = entry.fs = entry.gs = 0x10;
    entry.ss = 0x30;
    entry.cr0 = 0x11;
    entry.cr4 = 0x620;
    entry.gdtLimit = 0x18;
    entry.gdtBase = kGate;
    entry.imageStart = kEntry;
    entry.imageEnd = kImageEnd;

    args.revision = 4;
    args.version = 1;
    std::strcpy(args.commandLine, "-v foo=1");
    args.memoryMap = kMap;
    args.memoryDescriptorSize = kStride;
    args.memoryDescriptorVersion = 1;
    args.videoBaseAddress = 0x80000000;
    args.videoDisplayMode = 1;
    args.videoRowBytes = 5120;
    args.videoWidth = 1280;
    args.videoHeight = 800;
    args.videoDepth = 32;
    args.deviceTree = kTree;
    args.kernelRegionBase = kEntry;
    args.kernelRegionSize = kRegionEnd - kEntry;
    args.runtimePageStart = kRuntimeStart / 4096;
    args.runtimePageCount = (kRegionEnd - kRuntimeStart) / 4096;
    args.systemTable = kSystemTable;
    args.firmwareBits = 0x40;

    tree.Add("compatible", Text("ACPI")).Add("model", Text("ACPI"));
    Node &chosen = tree.Child("chosen");
    chosen.Add("boot-uuid", Text("7C3457EF-0000-11AA-AA11-00306543ECAC"))
        .Add("boot-file", Text("nimb_kernel"))
        .Add("boot-device-path", DevicePath())
        .Add("boot-args", Text("-v foo=1"));
    chosen.Child("memory-map")
        .Add("BootCLUT", Words({kClut, 0x300}))
        .Add("Pict-FailedBoot", Words({kPicture, 0x4020}))
        .Add("Driver-10c000", Words({kDriver, 0x800}));
    Node &efi = tree.Child("efi");
    efi.Add("firmware-vendor", Bytes{'T', 0, 'e', 0, 's', 0, 't', 0, 0, 0})
        .Add("firmware-revision", Words({0x10000}))
        .Add("firmware-abi", Text("EFI64"));
    efi.Child("runtime-services").Add("table", Words({0x7E001018, 0}));
    efi.Child("configuration-table")
        .Child("8868E871-E4F1-11D3-BC22-0080C73C8881")
        .Add("guid", Bytes(16, 0x88))
        .Add("table", Words({0x7F000000, 0}))
        .Add("alias", Text("ACPI_20"));

    map = {
        {7, 0, 0, 0xA0, 0xF},
        {2, kEntry, 0, (kRuntimeStart - kEntry) / 4096, 0xF},  // the kernel region
        {7, kRuntimeStart, 0, 0x100, 0xF},                     // free when the map was taken
        {1, kGate, 0, 1, 0xF},
        {0, 0x7F000000, 0, 0x10, 0},
        {7, 0x7E000000, 0x110000, 1, 0xF},  // the runtime regions' old places
        {7, 0x7E001000, 0x111000, 1, 0xF},
        {11, 0xFEC00000, 0x112000, 1, kRuntime | 1},
        {6, 0x110000, 0x110000, 1, kRuntime | 0xF},  // and their new ones
        {5, 0x111000, 0x111000, 1, kRuntime | 0xF},
    };
  }

  Descriptor &Type(uint32_t type) {
    for (Descriptor &descriptor : map) {
      if (descriptor.type == type) {
        return descriptor;
      }
    }
    throw std::runtime_error("no such descriptor");
  }

  void Install() {
    std::fill(gMemory.begin(), gMemory.end(), 0);
    Bytes flat = Flatten(tree);
    if (args.deviceTreeLength == 0) {
      args.deviceTreeLength = static_cast<uint32_t>(flat.size());
    }
    std::memcpy(At(kTree), flat.data(), flat.size());
    Bytes descriptors;
    for (const Descriptor &d : map) {
      Put32(descriptors, d.type);
      Put32(descriptors, 0);
      Put64(descriptors, d.physical);
      Put64(descriptors, d.virtualStart);
      Put64(descriptors, d.pages);
      Put64(descriptors, d.attribute);
      Put64(descriptors, 0);  // the firmware's stride is larger than the structure
    }
    if (args.memoryMapSize == 0) {
      args.memoryMapSize = static_cast<uint32_t>(descriptors.size());
    }
    std::memcpy(At(args.memoryMap), descriptors.data(), descriptors.size());
    std::memcpy(At(kBootArgsAddress), &args, sizeof(args));
    std::memcpy(At(kGate), gdt, sizeof(gdt));
    std::memcpy(At(kPicture), picture.data(), picture.size());
    std::memcpy(At(kDriver), driver.data(), driver.size());
    Bytes table;
    Put64(table, systemTableSignature);
    table.resize(g::kSystemTableRuntimeServices);
    Put64(table, runtimeServicesPointer);
    std::memcpy(At(kSystemTable), table.data(), table.size());
    Bytes services;
    Put64(services, runtimeServicesSignature);
    std::memcpy(At(kRuntimeServices), services.data(), services.size());
  }
};

struct Report {
  std::string text;
  bool pass;
  std::set<std::string> failed;
  size_t checks = 0;
};

Report Boot(FakeBoot &boot) {
  boot.Install();
  g::ReportReset();
  Report report;
  report.text = Capture([&] { report.pass = g::ReportBoot(boot.entry); });
  std::regex check(R"(^kernel: check (\S+) (ok|FAIL)( .*)?$)");
  std::istringstream lines(report.text);
  for (std::string line; std::getline(lines, line);) {
    std::smatch match;
    if (std::regex_match(line, match, check)) {
      report.checks++;
      if (match[2] == "FAIL") {
        report.failed.insert(match[1]);
      }
    }
  }
  return report;
}

TEST(GuestBoot, AGoodBootPassesAndIsReported) {
  FakeBoot boot;
  Report report = Boot(boot);
  EXPECT_TRUE(report.pass);
  EXPECT_TRUE(report.failed.empty()) << report.text;
  std::string result = "kernel: result pass (" + std::to_string(report.checks) + " checks, 0 failed)\n";
  ASSERT_GE(report.text.size(), result.size());
  EXPECT_EQ(report.text.substr(report.text.size() - result.size()), result);
  EXPECT_EQ(report.text.rfind("kernel: start\n", 0), 0u);
  for (const char *line : {
           "kernel: bootargs commandLine=\"-v foo=1\"\n",
           "kernel: bootargs videoDisplayMode=1\n",
           "kernel: bootargs videoWidth=1280\n",
           "kernel: bootargs runtimePageStart=0x110\n",
           "kernel: bootargs firmwareBits=0x40\n",
           "kernel: tree     boot-file = \"nimb_kernel\"\n",
           "kernel: tree     firmware-vendor = u\"Test\"\n",
           "kernel: tree     firmware-revision = <00 00 01 00> (0x10000)\n",
           "kernel: tree       table = <18 10 00 7e 00 00 00 00> (0x7e001018)\n",
           "kernel: tree       8868E871-E4F1-11D3-BC22-0080C73C8881/ (4 properties, 0 children)\n",
           "kernel: range Driver-10c000 address=0x10c000 length=0x800\n",
           "kernel: memmap type EfiRuntimeServicesCode count=1 pages=0x1\n",
           "kernel: memmap type EfiConventionalMemory count=4 pages=0x1a2\n",
           "kernel: memmap runtime EfiMemoryMappedIO physical=0xfec00000 virtual=0x112000 pages=0x1",
           "kernel: check memmap-runtime ok 3 runtime descriptors",
           "kernel: efi systemTable=0x110000 ",
           "runtimeServices=0x111000 ",
       }) {
    EXPECT_NE(report.text.find(line), std::string::npos) << line << "\n" << report.text;
  }
}

TEST(GuestBoot, EachBrokenPromiseFailsItsCheck) {
  using Set = std::set<std::string>;
  struct Row {
    const char *name;
    std::function<void(FakeBoot &)> breakIt;
    Set failed;
  } rows[] = {
      {"EBX differs from EAX", [](FakeBoot &b) { b.entry.ebx = 0x1234; }, {"entry-eax-ebx"}},
      {"EDI is not the entry", [](FakeBoot &b) { b.entry.edi += 4; }, {"entry-edi"}},
      {"ECX lost", [](FakeBoot &b) { b.entry.ecx = 0; }, {"entry-ecx"}},
      {"code selector 0x18", [](FakeBoot &b) { b.entry.cs = 0x18; }, {"entry-cs"}},
      {"FS not loaded", [](FakeBoot &b) { b.entry.fs = 0; }, {"entry-data-segments"}},
      {"paging on", [](FakeBoot &b) { b.entry.cr0 |= g::kCr0Pg; }, {"entry-cr0"}},
      {"real mode", [](FakeBoot &b) { b.entry.cr0 &= ~g::kCr0Pe; }, {"entry-cr0"}},
      {"long mode enabled", [](FakeBoot &b) { b.entry.eferLow |= g::kEferLme; }, {"entry-efer"}},
      {"interrupts on", [](FakeBoot &b) { b.entry.eflags |= g::kEflagsIf; }, {"entry-interrupts"}},
      {"descriptor table limit 0x17", [](FakeBoot &b) { b.entry.gdtLimit = 0x17; }, {"entry-gdt"}},
      {"64-bit code descriptor", [](FakeBoot &b) { b.gdt[1] |= 1ull << 53; }, {"entry-gdt"}},
      {"writable code descriptor", [](FakeBoot &b) { b.gdt[1] = 0x00CF9A000000FFFFull; }, {"entry-gdt"}},
      {"descriptor table unreadable", [](FakeBoot &b) { b.entry.gdtBase = 0x10; }, {"entry-gdt"}},
      {"BootArgs unreadable",
       [](FakeBoot &b) { b.entry.eax = b.entry.ebx = 0x900000; },
       {"bootargs-address"}},
      {"revision 3", [](FakeBoot &b) { b.args.revision = 3; }, {"bootargs-revision"}},
      {"version 2", [](FakeBoot &b) { b.args.version = 2; }, {"bootargs-version"}},
      {"32-bit firmware", [](FakeBoot &b) { b.args.firmwareBits = 0x20; }, {"bootargs-firmware-bits"}},
      {"reserved byte set", [](FakeBoot &b) { b.args.reserved[30] = 1; }, {"bootargs-reserved"}},
      {"command line without NUL",
       [](FakeBoot &b) { std::memset(b.args.commandLine, 'a', sizeof(b.args.commandLine)); },
       {"bootargs-command-line", "tree-boot-args"}},
      {"boot-args differs",
       [](FakeBoot &b) { *b.tree.Find("/chosen")->Property("boot-args") = Text("-v foo=2"); },
       {"tree-boot-args"}},
      {"boot-args without NUL",
       [](FakeBoot &b) { b.tree.Find("/chosen")->Property("boot-args")->pop_back(); },
       {"tree-boot-args"}},
      {"display mode 0", [](FakeBoot &b) { b.args.videoDisplayMode = 0; }, {"bootargs-video"}},
      {"no frame buffer, a width", [](FakeBoot &b) { b.args.videoBaseAddress = 0; }, {"bootargs-video"}},
      {"rows too short", [](FakeBoot &b) { b.args.videoRowBytes = 5116; }, {"bootargs-video"}},
      {"runtime area below the top",
       [](FakeBoot &b) { b.args.kernelRegionSize += 0x1000; },
       {"bootargs-runtime-area"}},
      {"no spare pages", [](FakeBoot &b) { b.args.runtimePageCount = 1; }, {"bootargs-runtime-area"}},
      {"tree length too long", [](FakeBoot &b) { b.args.deviceTreeLength = 0x1000; }, {"tree-walk"}},
      {"tree length too short", [](FakeBoot &b) { b.args.deviceTreeLength = 0x100; }, {"tree-walk"}},
      {"tree address unreadable",
       [](FakeBoot &b) { b.args.deviceTree = 0x10; },
       {"tree-walk", "region-layout", "memmap-loader-data"}},
      {"node without a name",
       [](FakeBoot &b) { b.tree.Find("/efi/runtime-services")->named = false; },
       {"tree-names", "tree-efi"}},
      {"root not named /", [](FakeBoot &b) { b.tree.name = "root"; }, {"tree-names"}},
      {"no model", [](FakeBoot &b) { b.tree.Remove("model"); }, {"tree-root"}},
      {"compatible without NUL",
       [](FakeBoot &b) {
         *b.tree.Property("compatible") = Bytes{'A', 'C', 'P', 'I'};
       },
       {"tree-root"}},
      {"no boot-file", [](FakeBoot &b) { b.tree.Find("/chosen")->Remove("boot-file"); }, {"tree-chosen"}},
      {"device path without end node",
       [](FakeBoot &b) { b.tree.Find("/chosen")->Property("boot-device-path")->resize(6); },
       {"tree-chosen"}},
      {"32-bit firmware ABI",
       [](FakeBoot &b) { *b.tree.Find("/efi")->Property("firmware-abi") = Text("EFI32"); },
       {"tree-efi"}},
      {"runtime table of 4 bytes",
       [](FakeBoot &b) { *b.tree.Find("/efi/runtime-services")->Property("table") = Words({1}); },
       {"tree-efi"}},
      {"range of 12 bytes",
       [](FakeBoot &b) {
         b.tree.Find("/chosen/memory-map")->Add("Odd", Words({1, 2, 3}));
       },
       {"ranges-entries"}},
      {"no memory-map node",
       [](FakeBoot &b) {
         auto &children = b.tree.Find("/chosen")->children;
         children.clear();
       },
       {"ranges-entries", "range-boot-clut", "range-failed-boot"}},
      {"range outside the region",
       [](FakeBoot &b) {
         b.tree.Find("/chosen/memory-map")->Add("Driver-180000", Words({0x180000, 0x100}));
       },
       {"ranges-inside", "memmap-loader-data", "driver-blocks"}},
      {"range in the runtime area",
       [](FakeBoot &b) {
         b.tree.Find("/chosen/memory-map")->Add("Extra", Words({kRuntimeStart + 0x3000, 0x100}));
       },
       {"ranges-inside", "memmap-loader-data"}},
      {"driver named for another address",
       [](FakeBoot &b) {
         *b.tree.Find("/chosen/memory-map")->Property("Driver-10c000") = Words({kDriver + 0x100, 8});
       },
       {"ranges-names", "driver-blocks"}},
      {"driver package named for another address",
       [](FakeBoot &b) {
         b.tree.Find("/chosen/memory-map")->Add("DriversPackage-10c900", Words({kDriver + 0x800, 8}));
       },
       {"ranges-names", "drivers-one-way"}},
      {"colour table of 0x200 bytes",
       [](FakeBoot &b) {
         *b.tree.Find("/chosen/memory-map")->Property("BootCLUT") = Words({kClut, 0x200});
       },
       {"range-boot-clut"}},
      {"failure picture 64 wide",
       [](FakeBoot &b) {
         b.picture = Words({64, 128, 0});
       },
       {"range-failed-boot"}},
      {"failure picture of 0x4000 bytes",
       [](FakeBoot &b) {
         *b.tree.Find("/chosen/memory-map")->Property("Pict-FailedBoot") = Words({kPicture, 0x4000});
       },
       {"range-failed-boot"}},
      {"two ranges overlap",
       [](FakeBoot &b) {
         b.tree.Find("/chosen/memory-map")->Add("Driver-106100", Words({kClut + 0x100, 8}));
       },
       {"region-layout", "driver-blocks"}},
      {"memory map outside the region",
       [](FakeBoot &b) { b.args.memoryMap = 0x120000; },
       {"region-layout", "memmap-loader-data"}},
      {"descriptor size 36", [](FakeBoot &b) { b.args.memoryDescriptorSize = 36; }, {"memmap-layout"}},
      {"map size not whole descriptors",
       [](FakeBoot &b) { b.args.memoryMapSize = 10 * kStride - 8; },
       {"memmap-layout"}},
      {"runtime data left in place",
       [](FakeBoot &b) { b.Type(6).physical = 0x7E000000; },
       {"memmap-runtime"}},
      {"runtime code in the spare pages",
       [](FakeBoot &b) { b.Type(5).physical = b.Type(5).virtualStart = kRegionEnd - 0x1000; },
       {"memmap-runtime"}},
      {"runtime descriptors overlap",
       [](FakeBoot &b) { b.Type(11).virtualStart = 0x111000; },
       {"memmap-runtime"}},
      {"reserved memory keeps the runtime bit",
       [](FakeBoot &b) { b.Type(0).attribute = kRuntime; },
       {"memmap-reserved"}},
      {"kernel pages not loader data", [](FakeBoot &b) { b.Type(2).type = 1; }, {"memmap-loader-data"}},
      {"system table signature", [](FakeBoot &b) { b.systemTableSignature ^= 1; }, {"efi-system-table"}},
      {"runtime services above 4 GiB",
       [](FakeBoot &b) { b.runtimeServicesPointer |= 1ull << 32; },
       {"efi-runtime-services"}},
      {"runtime services signature",
       [](FakeBoot &b) { b.runtimeServicesSignature = 0; },
       {"efi-runtime-services"}},
  };
  for (const Row &row : rows) {
    FakeBoot boot;
    row.breakIt(boot);
    Report report = Boot(boot);
    EXPECT_FALSE(report.pass) << row.name;
    EXPECT_EQ(report.failed, row.failed) << row.name << "\n" << report.text;
    std::string result = "kernel: result fail (" + std::to_string(report.checks) + " checks, " +
                         std::to_string(report.failed.size()) + " failed)\n";
    EXPECT_NE(report.text.find(result), std::string::npos) << row.name << "\n" << report.text;
  }
}

// --- the hold option ---------------------------------------------------------------

TEST(GuestHold, ReadsTheFirstHoldWord) {
  struct Row {
    const char *name;
    std::string line;
    uint32_t length;  // of the field; 0: the text's own length
    uint32_t seconds;
  };
  const std::vector<Row> rows = {
      {"alone", "guest.hold=4", 0, 4},
      {"between other words", "-v guest.hold=12 foo=1", 0, 12},
      {"tab and line feed separate", "a\tguest.hold=3\nb", 0, 3},
      {"absent", "-v foo=1", 0, 0},
      {"empty line", "", 0, 0},
      {"inside another word", "xguest.hold=4", 0, 0},
      {"key without the dot", "guesthold=4", 0, 0},
      {"key in another case", "Guest.Hold=4", 0, 0},
      {"no value", "guest.hold= -v", 0, 0},
      {"not all digits", "guest.hold=4s", 0, 0},
      {"first word counts", "guest.hold=2 guest.hold=9", 0, 2},
      {"capped", "guest.hold=99999999999999", 0, g::kMaxHoldSeconds},
      {"cut by the field's length", "guest.hold=45", 12, 4},
      {"stops at the NUL", std::string("guest.hold=4") + '\0' + "5", 14, 4},
  };
  for (const Row &row : rows) {
    uint32_t length = row.length != 0 ? row.length : static_cast<uint32_t>(row.line.size());
    EXPECT_EQ(g::HoldSeconds(row.line.data(), length), row.seconds) << row.name;
  }
}

}  // namespace

// --- the restart probe's key search and sums ------------------------------------------

// FIPS-197 appendix A: the last round key of each key size, and for 256
// bits the second round key in the equivalent inverse cipher's form, which
// is no byte of the key.
TEST(GuestResumeProbe, RoundKeysOfEachKeySize) {
  struct Row {
    const char *key, *wanted;
  };
  const Row rows[] = {
      {"2b7e151628aed2a6abf7158809cf4f3c", "d014f9a8c9ee2589e13f0cc8b6630ca6"},
      {"8e73b0f7da0e6452c810f32b809079e562f8ead2522c6b7b", "e98ba06f448c773c8ecc720401002202"},
      {"603deb1015ca71be2b73aef0857d77811f352c073b6108d72d9810a30914dff4",
       "fe4890d1e6188d0b046df344706c631e"},
  };
  auto bytes = [](const char *hex) {
    std::vector<uint8_t> out;
    for (; *hex != 0; hex += 2)
      out.push_back(static_cast<uint8_t>(std::stoi(std::string(hex, 2), nullptr, 16)));
    return out;
  };
  for (const Row &row : rows) {
    std::vector<uint8_t> key = bytes(row.key), wanted = bytes(row.wanted);
    uint8_t rounds[30][16];
    uint32_t count = g::AesRoundKeys(key.data(), static_cast<uint32_t>(key.size()), rounds);
    bool found = false, keyItself = false;
    for (uint32_t i = 0; i < count; i++) {
      found = found || std::memcmp(rounds[i], wanted.data(), 16) == 0;
      keyItself = keyItself || std::memcmp(rounds[i], key.data(), 16) == 0;
    }
    EXPECT_TRUE(found) << row.key;
    EXPECT_FALSE(keyItself) << row.key << ": the key's own bytes are searched as the key";
    EXPECT_EQ(count, 2 * (key.size() / 4 + 6) - key.size() / 16) << row.key;
  }
  EXPECT_EQ(g::AesRoundKeys(bytes("00").data(), 1, nullptr), 0u);
}

TEST(GuestResumeProbe, PageSumsAsTheLoaderMakesThem) {
  std::vector<uint8_t> pages(2 * 4096, 0);
  EXPECT_EQ(g::Adler32Pages(pages.data(), 1), 0x10000001u);
  std::fill(pages.begin() + 4096, pages.end(), 0xFF);
  EXPECT_EQ(g::Adler32Pages(pages.data() + 4096, 1), 0x8161F0E2u);
  EXPECT_EQ(g::Adler32Pages(pages.data(), 2), 0x10000001u + 0x8161F0E2u);
}

// --- drivers -------------------------------------------------------------------------

namespace {

// A staged block at `address`: header, text with its zero, code.
Bytes DriverBlock(uint32_t address, const std::string &plist, const Bytes &code) {
  Bytes text = Text(plist);
  Bytes block = Words({address + 16, static_cast<uint32_t>(text.size()),
                       code.empty() ? 0 : address + 16 + static_cast<uint32_t>(text.size()),
                       static_cast<uint32_t>(code.size())});
  block.insert(block.end(), text.begin(), text.end());
  block.insert(block.end(), code.begin(), code.end());
  return block;
}

TEST(GuestDrivers, BlocksPackageAndPrelinkedSegment) {
  constexpr uint32_t kImageEnd = 0x180123;  // the segment would be at 0x181000
  constexpr uint32_t kBlock = 0x190000;
  const std::string plist = "<dict><key>VzBundleIdentifier</key>\n<string>com.x.Disk</string></dict>";
  const Bytes code = {1, 2, 3, 4, 5};
  const Bytes good = DriverBlock(kBlock, plist, code);
  const uint32_t length = static_cast<uint32_t>(good.size());
  struct Row {
    const char *name;
    std::function<void()> setUp;  // on zeroed memory
    std::vector<g::Area> areas;
    const char *line;  // a line the report must hold
    std::set<std::string> failed;
  };
  auto put = [](uint32_t address, const Bytes &bytes) { std::copy(bytes.begin(), bytes.end(), At(address)); };
  auto staged = [&] { put(kBlock, good); };
  auto prelinked = [&] {
    put(0x181000, Words({0x4B4C504E, 2}));
    put(0x182000, DriverBlock(0x182000, plist, code));
    put(0x183000, DriverBlock(0x183000, "<key>x</key>", {}));
  };
  const Row rows[] = {
      {"a staged block",
       staged,
       {{"Driver-190000", kBlock, length}},
       "driver \"com.x.Disk\" from=loader address=0x190000 plist=0x47 code=0x5 sum=0x280010",
       {}},
      {"range one byte long",
       staged,
       {{"Driver-190000", kBlock, length + 1}},
       "drivers from=loader",
       {"driver-blocks"}},
      {"text without its zero",
       [&] {
         staged();
         At(kBlock + 16 + 0x46)[0] = '>';
       },
       {{"Driver-190000", kBlock, length}},
       "drivers from=loader",
       {"driver-blocks"}},
      {"a package",
       [&] { put(kBlock, code); },
       {{"DriversPackage-190000", kBlock, 5}},
       "package address=0x190000 length=0x5 sum=0x280010",
       {}},
      {"prelinked", prelinked, {}, "drivers from=cache blocks=2 package=0", {}},
      {"prelinked and staged",
       [&] {
         prelinked();
         staged();
       },
       {{"Driver-190000", kBlock, length}},
       "drivers from=cache blocks=3",
       {"drivers-one-way"}},
  };
  for (const Row &row : rows) {
    SCOPED_TRACE(row.name);
    std::fill(gMemory.begin(), gMemory.end(), 0);
    row.setUp();
    g::ReportReset();
    const g::KernelRegion region = {kMemoryBase, kMemoryBase + kMemorySize - 0x1000,
                                    kMemoryBase + kMemorySize};
    std::string text = Capture([&] {
      g::CheckDrivers(region, kImageEnd, row.areas.data(), 0, static_cast<uint32_t>(row.areas.size()));
    });
    EXPECT_NE(text.find(row.line), std::string::npos) << text;
    for (const char *check : {"driver-blocks", "drivers-one-way"}) {
      bool failed = text.find(std::string("check ") + check + " FAIL") != std::string::npos;
      EXPECT_EQ(failed, row.failed.count(check) == 1) << check << "\n" << text;
    }
  }
}

}  // namespace
