// Any bytes as a property list: the parse must stay inside the text, the tree
// must be walkable, and freeing it must give every tag and symbol back.

#include "config/plist.h"
#include "fuzz_firmware.h"

// Walks the whole tree, checking what each type may hold.
void Walk(const nimb::PlistTag *tag, int depth) {
  Check(depth < 1000);
  for (; tag != nullptr; tag = tag->next) {
    Check(tag->type >= nimb::kPlistDict && tag->type <= nimb::kPlistArray);
    bool hasText = tag->type == nimb::kPlistKey || tag->type == nimb::kPlistString;
    bool hasChild =
        tag->type == nimb::kPlistKey || tag->type == nimb::kPlistDict || tag->type == nimb::kPlistArray;
    Check(hasText == (tag->text != nullptr));
    if (!hasChild)
      Check(tag->child == nullptr);
    if (hasText)
      Check(std::strlen(tag->text) < 1 << 20);
    Walk(tag->child, depth + 1);
  }
}

size_t Length(const nimb::PlistTag *tag) {
  size_t n = 0;
  for (; tag != nullptr; tag = tag->next) {
    Check(tag->type == 0 && tag->text == nullptr && tag->child == nullptr);
    n++;
  }
  return n;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  std::vector<char> text(data, data + size);
  text.push_back('\0');

  // One firmware for the whole run: making one per input costs far more
  // than the parse. Each input starts and ends with nothing allocated.
  static hostfw::Firmware fw;
  nimbfuzz::AttachLoader(fw);
  nimb::gPlistFreeTags = nullptr;
  nimb::gPlistSymbols = nullptr;
  Check(fw.LivePoolBlocks() == 0);

  nimb::PlistTag *dict = nullptr;
  EFI_STATUS status = nimb::PlistParseDocument(text.data(), &dict);
  Check(text.back() == '\0');
  if (status == EFI_SUCCESS) {
    Check(dict != nullptr && dict->type == nimb::kPlistDict && dict->next == nullptr);
    Walk(dict, 0);
    for (const char *key : {"Kernel", "Kernel Flags", "A", "", "key"}) {
      nimb::PlistTag *value = nimb::PlistFindKey(dict, key);
      if (value != nullptr)
        nimb::PlistFindKey(value, key);
    }
  } else {
    Check(status == EFI_NOT_FOUND && dict == nullptr);
  }
  nimb::PlistFreeTag(dict);

  // All symbols are gone, and every record of every block is free again:
  // what is still tracked is the blocks of tags alone.
  Check(nimb::gPlistSymbols == nullptr);
  size_t blocks = 0;
  for (const nimb::MemoryTag *t = nimb::gMemoryTags; t != nullptr; t = t->next) {
    if (t->poolAddress != nullptr)
      blocks++;
  }
  Check(Length(nimb::gPlistFreeTags) == blocks * 4096);

  nimb::gPlistFreeTags = nullptr;
  nimbfuzz::FinishInput(fw, false);
  return 0;
}
