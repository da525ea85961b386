// The property list parser. The text is cut in place as it is scanned, tags
// come from pooled blocks, and every string is interned once with a count of
// the tags that hold it, so that a failed parse gives everything back.
#include "config/plist.h"

#include <stddef.h>

#include "memory/tracking.h"
#include "screen/console.h"
#include "support/strings.h"

namespace nimb {

PlistTag *gPlistFreeTags;
PlistSymbol *gPlistSymbols;
PlistSymbolIndex gPlistSymbolIndex;

namespace {

constexpr UINTN kPlistTagBlockSize = 131072;
constexpr UINTN kPlistTagsPerBlock = kPlistTagBlockSize / sizeof(PlistTag);

// The parse recurses once for every container and key that is open. The
// firmware's stack is small and of unknown size, and a hostile or broken
// file could nest without end, so the open elements are bounded far above
// anything a real configuration or bundle description holds; deeper input
// is a parse failure like any other. The bound also bounds the recursion of
// PlistFreeTag into `child`.
constexpr UINT64 kPlistMaxDepth = 256;

UINT64 ParseTag(char *text, PlistTag **tag, UINT64 depth);
UINT64 ParseList(char *text, PlistTag **tag, UINT64 type, BOOLEAN empty, UINT64 depth);

// The symbols' index. The bucket count is a power of two; the index grows
// fourfold when the symbols outnumber the buckets twice.
constexpr UINT64 kPlistFirstBuckets = 64;

UINT64 HashText(const char *text) {
  UINT64 hash = 0xCBF29CE484222325ULL;
  for (const char *p = text; *p != '\0'; p++) {
    hash = (hash ^ static_cast<UINT8>(*p)) * 0x100000001B3ULL;
  }
  return hash;
}

// The index, or null when there is none. An index whose list was set aside
// from outside (all tracked memory given back at once) went with it.
PlistSymbolIndex *Index() {
  if (gPlistSymbolIndex.buckets != nullptr && gPlistSymbolIndex.list != gPlistSymbols) {
    gPlistSymbolIndex = {};
  }
  return gPlistSymbolIndex.buckets != nullptr ? &gPlistSymbolIndex : nullptr;
}

// Builds the index anew over every symbol, with at least `buckets` buckets;
// without memory for it, the old index (or none) stays.
void Reindex(UINT64 buckets) {
  UINT64 count = 0;
  for (const PlistSymbol *symbol = gPlistSymbols; symbol != nullptr; symbol = symbol->next) {
    count++;
  }
  while (buckets < count) {
    buckets *= 2;
  }
  PlistSymbol **heads = static_cast<PlistSymbol **>(TrackedAllocatePool(buckets * sizeof(PlistSymbol *)));
  if (heads == nullptr) {
    return;
  }
  bzero(heads, buckets * sizeof(PlistSymbol *));
  for (PlistSymbol *symbol = gPlistSymbols; symbol != nullptr; symbol = symbol->next) {
    PlistSymbol **head = &heads[symbol->hash & (buckets - 1)];
    symbol->chain = *head;
    *head = symbol;
  }
  if (Index() != nullptr) {
    TrackedFree(gPlistSymbolIndex.buckets);
  }
  gPlistSymbolIndex = {heads, buckets - 1, count, gPlistSymbols};
}

PlistSymbol *FindSymbol(const char *text, UINT64 hash, const PlistSymbolIndex *index) {
  PlistSymbol *symbol = index != nullptr ? index->buckets[hash & index->mask] : gPlistSymbols;
  for (; symbol != nullptr; symbol = index != nullptr ? symbol->chain : symbol->next) {
    if (symbol->hash == hash && strcmp(symbol->text, text) == 0) {
      return symbol;
    }
  }
  return nullptr;
}

// Drops one holder of an interned string; the last one frees the symbol.
void ReleaseSymbol(const char *text) {
  PlistSymbolIndex *index = Index();
  PlistSymbol *symbol = FindSymbol(text, HashText(text), index);
  if (symbol == nullptr || --symbol->refCount != 0) {
    return;
  }
  if (symbol->previous != nullptr) {
    symbol->previous->next = symbol->next;
  } else {
    gPlistSymbols = symbol->next;
  }
  if (symbol->next != nullptr) {
    symbol->next->previous = symbol->previous;
  }
  if (index != nullptr) {
    PlistSymbol **link = &index->buckets[symbol->hash & index->mask];
    while (*link != symbol) {
      link = &(*link)->chain;
    }
    *link = symbol->chain;
    index->count--;
    index->list = gPlistSymbols;
    if (gPlistSymbols == nullptr) {
      TrackedFree(index->buckets);
      gPlistSymbolIndex = {};
    }
  }
  TrackedFree(symbol);
}

// A tag of `type` with no fields, or null when no record can be had.
PlistTag *NewTagOfType(UINT64 type) {
  PlistTag *tag = PlistNewTag();
  if (tag != nullptr) {
    tag->type = type;
  }
  return tag;
}

// A text element: the content up to the closing tag of `name`, interned
// into a tag of `type` when `keepText` is set, else dropped.
UINT64 ParseTextElement(char *text, PlistTag **tag, const char *name, UINT64 type, bool keepText) {
  UINT64 length = PlistCutContent(text, name);
  if (length == kPlistFailure) {
    return kPlistFailure;
  }
  PlistTag *element = NewTagOfType(type);
  if (element == nullptr) {
    return kPlistFailure;
  }
  if (keepText) {
    element->text = PlistInternSymbol(text);
  }
  *tag = element;
  return length;
}

// A key and the element behind it, which is its value.
UINT64 ParseKey(char *text, PlistTag **tag, UINT64 depth) {
  UINT64 offset = PlistCutContent(text, "key");
  if (offset == kPlistFailure || depth >= kPlistMaxDepth) {
    return kPlistFailure;
  }
  PlistTag *value = nullptr;
  UINT64 length = ParseTag(text + offset, &value, depth + 1);
  if (length == kPlistFailure) {
    return kPlistFailure;
  }
  PlistTag *key = NewTagOfType(kPlistKey);
  if (key == nullptr) {
    PlistFreeTag(value);
    return kPlistFailure;
  }
  key->text = PlistInternSymbol(text);
  key->child = value;
  *tag = key;
  return offset + length;
}

// Adds the length of the opening tag to the offset of what followed it.
UINT64 Behind(UINT64 tagLength, UINT64 length) {
  return length == kPlistFailure ? kPlistFailure : tagLength + length;
}

UINT64 ParseTag(char *text, PlistTag **tag, UINT64 depth) {
  *tag = nullptr;
  char *name = nullptr;
  UINT64 length = PlistNextTag(text, &name, nullptr);
  if (length == kPlistFailure) {
    return kPlistFailure;
  }
  char *behind = text + length;

  if (strncmp(name, "plist ", 6) == 0) {
    return length;
  }
  if (strcmp(name, "dict") == 0) {
    return Behind(length, ParseList(behind, tag, kPlistDict, false, depth));
  }
  if (strcmp(name, "dict/") == 0) {
    return Behind(length, ParseList(behind, tag, kPlistDict, true, depth));
  }
  if (strcmp(name, "key") == 0) {
    return Behind(length, ParseKey(behind, tag, depth));
  }
  if (strcmp(name, "string") == 0) {
    return Behind(length, ParseTextElement(behind, tag, "string", kPlistString, true));
  }
  if (strcmp(name, "integer") == 0) {
    return Behind(length, ParseTextElement(behind, tag, "integer", kPlistInteger, false));
  }
  if (strcmp(name, "data") == 0) {
    return Behind(length, ParseTextElement(behind, tag, "data", kPlistData, false));
  }
  if (strcmp(name, "date") == 0) {
    return Behind(length, ParseTextElement(behind, tag, "date", kPlistDate, false));
  }
  if (strcmp(name, "false/") == 0 || strcmp(name, "true/") == 0) {
    *tag = NewTagOfType(name[0] == 'f' ? kPlistFalse : kPlistTrue);
    return *tag == nullptr ? kPlistFailure : length;
  }
  if (strcmp(name, "array") == 0) {
    return Behind(length, ParseList(behind, tag, kPlistArray, false, depth));
  }
  if (strcmp(name, "array/") == 0) {
    return Behind(length, ParseList(behind, tag, kPlistArray, true, depth));
  }
  // Closing tags, declarations, comments and everything outside the
  // vocabulary make no tag.
  return length;
}

UINT64 ParseList(char *text, PlistTag **tag, UINT64 type, BOOLEAN empty, UINT64 depth) {
  *tag = nullptr;
  PlistTag *head = nullptr;
  UINT64 offset = 0;
  if (!empty) {
    if (depth >= kPlistMaxDepth) {
      return kPlistFailure;
    }
    for (;;) {
      PlistTag *item = nullptr;
      UINT64 length = ParseTag(text + offset, &item, depth + 1);
      if (length == kPlistFailure) {
        PlistFreeTag(head);
        return kPlistFailure;
      }
      offset += length;
      if (item == nullptr) {
        break;
      }
      item->next = head;
      head = item;
    }
  }
  PlistTag *container = NewTagOfType(type);
  if (container == nullptr) {
    PlistFreeTag(head);
    return kPlistFailure;
  }
  container->child = head;
  *tag = container;
  return offset;
}

}  // namespace

UINT64 PlistNextTag(char *text, char **name, UINT64 *tagStart) {
  UINT64 start = 0;
  while (text[start] != '<') {
    if (text[start] == '\0') {
      return kPlistFailure;
    }
    start++;
  }
  UINT64 end = start + 1;
  while (text[end] != '>') {
    if (text[end] == '\0') {
      return kPlistFailure;
    }
    end++;
  }
  *name = text + start + 1;
  text[end] = '\0';
  if (tagStart != nullptr) {
    *tagStart = start;
  }
  return end + 1;
}

UINT64 PlistCutContent(char *text, const char *name) {
  UINT64 offset = 0;
  for (;;) {
    char *tagName = nullptr;
    UINT64 tagStart = 0;
    UINT64 length = PlistNextTag(text + offset, &tagName, &tagStart);
    if (length == kPlistFailure) {
      return kPlistFailure;
    }
    if (tagName[0] == '/' && strcmp(tagName + 1, name) == 0) {
      text[offset + tagStart] = '\0';
      return offset + length;
    }
    offset += length;
  }
}

UINT64 PlistParseTag(char *text, PlistTag **tag) {
  return ParseTag(text, tag, 0);
}

UINT64 PlistParseList(char *text, PlistTag **tag, UINT64 type, BOOLEAN empty) {
  return ParseList(text, tag, type, empty, 0);
}

EFI_STATUS PlistParseDocument(char *text, PlistTag **dict) {
  *dict = nullptr;
  UINT64 offset = 0;
  for (;;) {
    PlistTag *tag = nullptr;
    UINT64 length = PlistParseTag(text + offset, &tag);
    if (length == kPlistFailure) {
      return EFI_NOT_FOUND;
    }
    offset += length;
    if (tag == nullptr) {
      continue;
    }
    if (tag->type == kPlistDict) {
      *dict = tag;
      return EFI_SUCCESS;
    }
    PlistFreeTag(tag);
  }
}

PlistTag *PlistFindKey(PlistTag *tag, const char *key) {
  if (tag == nullptr || tag->type != kPlistDict) {
    return nullptr;
  }
  for (PlistTag *child = tag->child; child != nullptr; child = child->next) {
    if (child->type == kPlistKey && child->text != nullptr && strcmp(child->text, key) == 0) {
      return child->child;
    }
  }
  return nullptr;
}

// Releases the tag and every sibling behind it. The sibling chain of a large
// dictionary or array can be long, and a recursion along `next` would take a
// stack frame per sibling, so the chain is walked in a loop; only `child` is
// followed recursively, and its depth is bounded by the parse. The records
// reach the free list in the same order as a release of child, then next,
// then the tag itself would put them there.
void PlistFreeTag(PlistTag *tag) {
  if (tag == nullptr) {
    return;
  }
  PlistTag *last = tag;
  for (PlistTag *current = tag; current != nullptr; current = current->next) {
    if (current->text != nullptr) {
      ReleaseSymbol(current->text);
    }
    PlistFreeTag(current->child);
    current->type = 0;
    current->text = nullptr;
    current->child = nullptr;
    last = current;
  }
  // The chain is already linked in order: it goes onto the free list whole.
  last->next = gPlistFreeTags;
  gPlistFreeTags = tag;
}

char *PlistInternSymbol(const char *text) {
  PlistSymbolIndex *index = Index();
  const UINT64 hash = HashText(text);
  PlistSymbol *symbol = FindSymbol(text, hash, index);
  if (symbol != nullptr) {
    symbol->refCount++;
    return symbol->text;
  }
  UINTN size = strlen(text) + 1;
  symbol = static_cast<PlistSymbol *>(TrackedAllocatePool(offsetof(PlistSymbol, text) + size));
  if (symbol == nullptr) {
    Fatal("NULL symbol!");
  }
  memcpy(symbol->text, text, size);
  symbol->refCount = 1;
  symbol->hash = hash;
  symbol->previous = nullptr;
  symbol->next = gPlistSymbols;
  if (symbol->next != nullptr) {
    symbol->next->previous = symbol;
  }
  gPlistSymbols = symbol;
  if (index == nullptr) {
    Reindex(kPlistFirstBuckets);
  } else {
    PlistSymbol **head = &index->buckets[hash & index->mask];
    symbol->chain = *head;
    *head = symbol;
    index->count++;
    index->list = gPlistSymbols;
    if (index->count > 2 * (index->mask + 1)) {
      Reindex(4 * (index->mask + 1));
    }
  }
  return symbol->text;
}

PlistTag *PlistNewTag() {
  if (gPlistFreeTags == nullptr) {
    PlistTag *block = static_cast<PlistTag *>(TrackedAllocatePool(kPlistTagBlockSize));
    if (block == nullptr) {
      return nullptr;
    }
    // Cleared field by field in the same pass that links the records.
    for (UINTN i = 0; i < kPlistTagsPerBlock; i++) {
      block[i].type = 0;
      block[i].text = nullptr;
      block[i].child = nullptr;
      block[i].next = i + 1 < kPlistTagsPerBlock ? &block[i + 1] : nullptr;
    }
    gPlistFreeTags = block;
  }
  PlistTag *tag = gPlistFreeTags;
  gPlistFreeTags = tag->next;
  // A record in use starts with every field clear; its link is set by the
  // list that takes it.
  tag->next = nullptr;
  return tag;
}

}  // namespace nimb
