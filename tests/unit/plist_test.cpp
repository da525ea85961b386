// The property list parser: what the cut text gives, how trees come out for
// the quirks of the element vocabulary, shared symbols, the tag pool, and
// that every failure gives back all it took.
#include "config/plist.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <deque>
#include <string>
#include <vector>

#include "loader_fixture.h"

namespace {

using nimb::gPlistFreeTags;
using nimb::gPlistSymbols;
using nimb::kPlistFailure;
using nimb::PlistSymbol;
using nimb::PlistTag;

constexpr size_t kTagsPerBlock = 4096;

// `open` n times, `inner`, then `close` n times.
std::string Nested(const std::string &open, const std::string &inner, const std::string &close, size_t n) {
  std::string text;
  for (size_t i = 0; i < n; i++)
    text += open;
  text += inner;
  for (size_t i = 0; i < n; i++)
    text += close;
  return text;
}

class PlistTest : public nimbtest::LoaderTest {
 protected:
  // A writable, zero-terminated copy that lives as long as the test.
  char *Text(const std::string &text) {
    texts_.emplace_back(text.begin(), text.end());
    texts_.back().push_back('\0');
    return texts_.back().data();
  }

  PlistTag *Parse(const std::string &text, EFI_STATUS expected = EFI_SUCCESS) {
    PlistTag *dict = reinterpret_cast<PlistTag *>(1);
    EXPECT_EQ(nimb::PlistParseDocument(Text(text), &dict), expected) << text;
    if (expected != EFI_SUCCESS)
      EXPECT_EQ(dict, nullptr) << text;
    return dict;
  }

  // Makes the first block of tags, so that counts of the free list compare.
  void PrimePool() {
    nimb::PlistFreeTag(nimb::PlistNewTag());
    ASSERT_EQ(FreeTags(), kTagsPerBlock);
  }

  // The free list's length; every free record is cleared.
  static size_t FreeTags() {
    size_t n = 0;
    for (const PlistTag *t = gPlistFreeTags; t != nullptr; t = t->next, n++)
      EXPECT_TRUE(t->type == 0 && t->text == nullptr && t->child == nullptr);
    return n;
  }

  // Symbol texts with their counts, newest first.
  static std::vector<std::pair<std::string, uint64_t>> Symbols() {
    std::vector<std::pair<std::string, uint64_t>> list;
    for (const PlistSymbol *s = gPlistSymbols; s != nullptr; s = s->next)
      list.emplace_back(s->text, s->refCount);
    return list;
  }

  // One tag and everything under it, children in chain order:
  // dict{K:"v",...}, array[...], a key as name:value, "_" for null; a field
  // that the type does not use shows as "!".
  static std::string Describe(const PlistTag *t) {
    if (t == nullptr)
      return "_";
    static const char *const kNames[] = {"?",    "dict", "",      "",     "integer",
                                         "data", "date", "false", "true", "array"};
    const std::string text = t->text ? t->text : "(null)";
    const bool list = t->type == nimb::kPlistDict || t->type == nimb::kPlistArray;
    if (t->type == nimb::kPlistKey)
      return text + ":" + Describe(t->child);
    if (t->type == nimb::kPlistString)
      return "\"" + text + "\"" + (t->child != nullptr ? "!" : "");
    std::string out = std::string(t->type < 10 ? kNames[t->type] : "?") + (t->text != nullptr ? "!" : "");
    if (!list)
      return out + (t->child != nullptr ? "!" : "");
    out += t->type == nimb::kPlistDict ? "{" : "[";
    for (const PlistTag *c = t->child; c != nullptr; c = c->next)
      out += (c != t->child ? "," : "") + Describe(c);
    return out + (t->type == nimb::kPlistDict ? "}" : "]");
  }

  std::deque<std::vector<char>> texts_;
};

TEST_F(PlistTest, CutContentEndsAtTheExactClosingName) {
  struct Row {
    const char *text;  // what follows the opening tag
    const char *name;
    uint64_t offset;
    const char *content;
  };
  const Row rows[] = {
      {"abc</key>rest", "key", 9, "abc"},
      {"a<b>c</string>", "string", 14, "a<b"},
      {"a</key>b</string>", "string", 17, "a</key"},
      {"abc</key", "key", kPlistFailure, nullptr},
      {"abc</Key>", "key", kPlistFailure, nullptr},
  };
  for (const Row &row : rows) {
    char *text = Text(row.text);
    uint64_t offset = nimb::PlistCutContent(text, row.name);
    ASSERT_EQ(offset, row.offset) << row.text;
    if (offset != kPlistFailure)
      EXPECT_STREQ(text, row.content) << row.text;
  }
}

TEST_F(PlistTest, DocumentsAndTheQuirksOfTheVocabulary) {
  struct Row {
    const char *text;
    const char *tree;  // null: EFI_NOT_FOUND
  };
  const Row rows[] = {
      // Children run in reverse file order.
      {"<dict><key>A</key><string>1</string><key>B</key><string>2</string></dict>", R"(dict{B:"2",A:"1"})"},
      {"<dict><key>L</key><array><string>x</string><string>y</string></array></dict>",
       R"(dict{L:array["y","x"]})"},
      {"<?xml version=\"1.0\"?><!DOCTYPE plist><plist version=\"1.0\"><dict/></plist>", "dict{}"},
      // Booleans only without a blank; anything else outside the vocabulary
      // leaves the key without a value.
      {"<dict><key>T</key><true/><key>S</key><true /><key>F</key><false/><key>G</key><false></dict>",
       "dict{G:_,F:false,S:_,T:true}"},
      {"<dict><key>N</key><integer>5</integer><key>D</key><data>AAEC</data><key>W</key><date>2001</date></"
       "dict>",
       "dict{W:date,D:data,N:integer}"},
      // A closing tag of an unknown value ends the dictionary early.
      {"<dict><key>D</key><dict><key>A</key><real>1</real><key>B</key><string>b</string></dict>"
       "<key>C</key><string>c</string></dict>",
       R"(dict{B:"b",D:dict{A:_}})"},
      {"<dict><key>E</key><string/><key>F</key><string>f</string></dict>", R"(dict{F:"f",E:_})"},
      // Directly in a container, <string/> ends it; the rest falls outward.
      {"<dict><key>L</key><array><string>x</string><string/><string>y</string></array>"
       "<key>M</key><string>m</string></dict>",
       R"(dict{"y",L:array["x"]})"},
      {"<dict><key> A </key><string>&lt;x&gt;</string><key></key><string></string></dict>",
       R"(dict{:"", A :"&lt;x&gt;"})"},
      // Any tag that makes nothing closes a container.
      {"<dict><key>A</key><string>1</string><!-- c --><key>B</key><string>2</string></dict>",
       R"(dict{A:"1"})"},
      // A key at the end takes the closing tag as its value and goes on.
      {"<plist version=\"1.0\"><dict><key>A</key><string>1</string><key>Z</key></dict>"
       "<key>B</key><string>2</string></plist>",
       R"(dict{B:"2",Z:_,A:"1"})"},
      // What stands before the first dictionary is parsed and dropped.
      {"<string>x</string><array><string>y</string></array><key>k</key><string>v</string>"
       "<dict version=\"1\"><Dict><dict/>",
       "dict{}"},
      {"<plist version=\"1.0\"><string>x</string><array><string>y</string></array></plist>", nullptr},
      {"plain text", nullptr},
      {"<dict><key>A</key><string>1</string>", nullptr},
  };
  PrimePool();
  for (const Row &row : rows) {
    PlistTag *dict = Parse(row.text, row.tree ? EFI_SUCCESS : EFI_NOT_FOUND);
    if (row.tree != nullptr)
      EXPECT_EQ(Describe(dict), row.tree) << row.text;
    if (dict != nullptr)
      EXPECT_EQ(dict->next, nullptr) << row.text;
    nimb::PlistFreeTag(dict);
    // Whatever was parsed, kept or dropped, is all back.
    EXPECT_EQ(FreeTags(), kTagsPerBlock) << row.text;
    EXPECT_TRUE(Symbols().empty()) << row.text;
  }
}

TEST_F(PlistTest, FindKeyTakesTheLastInTheFileAndSkipsWhatIsNoKey) {
  PlistTag *dict = Parse(
      "<dict><key>A</key><string>1</string><key>B</key><string>2</string><key>A</key><string>3</string>"
      "<key>N</key><integer>5</integer><key>E</key><string>early</string><key>E</key><string/>"
      "<string>loose</string><key>a</key><string>lower</string></dict>");
  ASSERT_NE(dict, nullptr);
  struct Row {
    const char *key;
    const char *value;  // Describe() of the value
  };
  const Row rows[] = {
      {"A", R"("3")"},     {"N", "integer"}, {"E", "_"},  // a key without value hides none
      {"a", R"("lower")"}, {"loose", "_"},
  };
  for (const Row &row : rows) {
    EXPECT_EQ(Describe(nimb::PlistFindKey(dict, row.key)), row.value) << row.key;
  }
  EXPECT_EQ(nimb::PlistFindKey(nullptr, "A"), nullptr);
  EXPECT_EQ(nimb::PlistFindKey(nimb::PlistFindKey(dict, "A"), "A"), nullptr) << "a string is no dictionary";
}

TEST_F(PlistTest, SymbolsAreSharedAndGoWithTheirLastHolder) {
  PrimePool();
  size_t pools = fw.LivePoolBlocks();
  PlistTag *first = Parse("<dict><key>A</key><string>A</string><key>B</key><string>A</string></dict>");
  PlistTag *second = Parse("<dict><key>A</key><string>x</string></dict>");
  using List = std::vector<std::pair<std::string, uint64_t>>;
  EXPECT_EQ(Symbols(), (List{{"x", 1}, {"B", 1}, {"A", 4}}));
  EXPECT_EQ(nimb::PlistFindKey(first, "A")->text, second->child->text);
  // One block per symbol, and the index while any symbol lives.
  EXPECT_EQ(fw.LivePoolBlocks(), pools + 4);
  nimb::PlistFreeTag(first);
  EXPECT_EQ(Symbols(), (List{{"x", 1}, {"A", 1}}));
  // A text that was never interned is passed over.
  PlistTag *stray = nimb::PlistNewTag();
  stray->type = nimb::kPlistString;
  stray->text = Text("y");
  nimb::PlistFreeTag(stray);
  nimb::PlistFreeTag(second);
  EXPECT_TRUE(Symbols().empty());
  EXPECT_EQ(fw.LivePoolBlocks(), pools);
}

// Thousands of symbols, through every growth of the index: each is found
// again, and each goes with its last holder, in any order.
TEST_F(PlistTest, ManySymbolsAreFoundAndReleased) {
  PrimePool();
  std::vector<std::string> texts;
  std::vector<char *> first;
  for (int i = 0; i < 5000; i++) {
    texts.push_back("key" + std::to_string(i * 7919 % 5000));
    first.push_back(nimb::PlistInternSymbol(texts.back().c_str()));
  }
  for (size_t i = 0; i < texts.size(); i++)
    ASSERT_EQ(nimb::PlistInternSymbol(texts[i].c_str()), first[i]) << texts[i];
  EXPECT_STREQ(gPlistSymbols->text, texts.back().c_str()) << "newest first";
  // The index grew with them and spreads them: short chains.
  const nimb::PlistSymbolIndex &index = nimb::gPlistSymbolIndex;
  ASSERT_NE(index.buckets, nullptr);
  EXPECT_GE(2 * (index.mask + 1), 5000u);
  for (UINT64 b = 0; b <= index.mask; b++) {
    size_t length = 0;
    for (const PlistSymbol *s = index.buckets[b]; s != nullptr; s = s->chain)
      length++;
    ASSERT_LE(length, 12u) << b;
  }
  for (int round = 0; round < 2; round++) {
    for (size_t i = round; i < texts.size(); i += 2) {
      for (int holder = 0; holder < 2; holder++) {
        PlistTag *tag = nimb::PlistNewTag();
        tag->type = nimb::kPlistString;
        tag->text = first[i];
        nimb::PlistFreeTag(tag);
      }
    }
    EXPECT_EQ(Symbols().size(), round == 0 ? 2500u : 0u);
  }
  EXPECT_EQ(nimb::gPlistSymbolIndex.buckets, nullptr) << "the index goes with the last symbol";
}

TEST_F(PlistTest, TagsComeFromZeroedBlocksAndNoMemoryForThemFailsTheParse) {
  PlistTag *first = nimb::PlistNewTag();
  EXPECT_EQ(first->next, nullptr);
  EXPECT_EQ(gPlistFreeTags, first + 1);
  EXPECT_EQ(FreeTags(), kTagsPerBlock - 1);
  // A freed tag is handed out again before any other.
  nimb::PlistFreeTag(first);
  EXPECT_EQ(nimb::PlistNewTag(), first);
  nimb::TrackedFreeAll();
  nimbtest::ResetConfigurationState();

  // Memory tags are made once, so that the next allocation is the block.
  ASSERT_EQ(nimb::TrackedFree(nimb::TrackedAllocatePool(8)), EFI_SUCCESS);
  fw.FailCall("AllocatePool", 1, EFI_OUT_OF_RESOURCES);
  EXPECT_EQ(nimb::PlistNewTag(), nullptr);
  fw.FailCall("AllocatePool", 1, EFI_OUT_OF_RESOURCES);
  PlistTag *tag = reinterpret_cast<PlistTag *>(1);
  EXPECT_EQ(nimb::PlistParseTag(Text("<true/>"), &tag), kPlistFailure);
  EXPECT_EQ(tag, nullptr);
  // The next attempt may take a block again.
  EXPECT_NE(nimb::PlistNewTag(), nullptr);

  fw.FailCall("AllocatePool", 1, EFI_OUT_OF_RESOURCES);
  hostfw::RunResult result = fw.Call([] { nimb::PlistInternSymbol("abc"); });
  EXPECT_EQ(result.end, hostfw::RunEnd::Exited);
  EXPECT_EQ(result.status, EFI_ABORTED);
  EXPECT_EQ(fw.ConOutText(), "NULL symbol!");
}

TEST_F(PlistTest, AFailureAnywhereGivesBackAllItTook) {
  struct Row {
    const char *name;
    std::string text;
  };
  const Row rows[] = {
      {"cut off deep inside",
       "<dict><key>A</key><array><dict><key>b</key><string>b</string><key>C</key>"
       "<array><string>A</string><string>c</string>"},
      {"text element without its end deep inside",
       "<dict><key>A</key><array><dict><key>b</key><string>b</string></dict>"
       "<dict><key>C</key><string>c</dict></array></dict>"},
      {"too deep", "<dict><key>A</key><string>b</string><key>deep</key>" +
                       Nested("<array>", "<string>b</string>", "</array>", 300) + "</dict>"},
  };
  PrimePool();
  // Another tree holds the same symbols: their counts must come back to 1.
  PlistTag *held = Parse("<dict><key>A</key><string>b</string></dict>");
  const auto symbols = Symbols();
  const size_t freeTags = FreeTags();
  for (const Row &row : rows) {
    Parse(row.text, EFI_NOT_FOUND);
    EXPECT_EQ(FreeTags(), freeTags) << row.name;
    EXPECT_EQ(Symbols(), symbols) << row.name;
  }
  EXPECT_EQ(Describe(held), R"(dict{A:"b"})");

  // Out of tags in the middle: three records left, five needed. The texts
  // are interned already, so the block is the only allocation.
  for (size_t n = FreeTags(); n > 3; n--)
    nimb::PlistNewTag();
  fw.FailCall("AllocatePool", 1, EFI_OUT_OF_RESOURCES);
  Parse("<dict><key>A</key><string>b</string><key>b</key><string>A</string></dict>", EFI_NOT_FOUND);
  EXPECT_EQ(FreeTags(), 3u);
  EXPECT_EQ(Symbols(), symbols);
}

TEST_F(PlistTest, NestingIsBoundedAt256OpenContainersAndKeys) {
  struct Row {
    const char *open;
    const char *inner;
    const char *close;
    int depth;
    bool ok;
  };
  const Row rows[] = {
      {"<array>", "<true/>", "</array>", 256, true},
      {"<array>", "<true/>", "</array>", 257, false},
      {"<dict><key>k</key>", "<true/>", "</dict>", 128, true},
      {"<dict><key>k</key>", "<true/>", "</dict>", 129, false},
  };
  PrimePool();
  for (const Row &row : rows) {
    const std::string text = Nested(row.open, row.inner, row.close, row.depth);
    const std::string what = std::string(row.open) + " x" + std::to_string(row.depth);
    PlistTag *tag = nullptr;
    EXPECT_EQ(nimb::PlistParseTag(Text(text), &tag), row.ok ? text.size() : kPlistFailure) << what;
    EXPECT_EQ(tag != nullptr, row.ok) << what;
    nimb::PlistFreeTag(tag);
    EXPECT_EQ(FreeTags() % kTagsPerBlock, 0u) << what;
    EXPECT_TRUE(Symbols().empty()) << what;
  }
}

TEST_F(PlistTest, ALongListIsFreedWithoutALongRecursion) {
  // Enough siblings that a frame per sibling would overrun the stack.
  const size_t count = 500000;
  const std::string text = "<array>" + Nested("", "", "<true/>", count) + "</array>";
  PlistTag *array = nullptr;
  ASSERT_EQ(nimb::PlistParseTag(Text(text), &array), text.size());
  nimb::PlistFreeTag(array);
  size_t blocks = (count + 1 + kTagsPerBlock - 1) / kTagsPerBlock;
  EXPECT_EQ(FreeTags(), blocks * kTagsPerBlock);
}

}  // namespace
