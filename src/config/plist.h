// The property list parser: a small, destructive reader of the XML property
// lists of the configuration file and of driver bundles. It knows `<` and
// `>`, a fixed vocabulary of element names and nothing else.
#pragma once

#include "efi/efi.h"

namespace nimb {

enum : UINT64 {
  kPlistDict = 1,
  kPlistKey = 2,
  kPlistString = 3,
  kPlistInteger = 4,
  kPlistData = 5,
  kPlistDate = 6,
  kPlistFalse = 7,
  kPlistTrue = 8,
  kPlistArray = 9,
};

// One node of a parsed list. Sibling chains run in reverse file order.
struct PlistTag {
  UINT64 type;      // 0 in a free record
  char *text;       // key name or string value (interned); else null
  PlistTag *child;  // first child of a list; a key's value
  PlistTag *next;   // next sibling; next free record
};
static_assert(sizeof(PlistTag) == 32, "four 64-bit fields");

// One interned string; its text follows the fields. `next` links the list
// of all symbols, newest first; `previous` and `chain` (the next symbol of
// the same hash bucket) serve the index, so that finding and releasing a
// symbol take the same time however many there are.
struct PlistSymbol {
  UINT64 refCount;
  PlistSymbol *next;
  PlistSymbol *previous;
  PlistSymbol *chain;
  UINT64 hash;
  char text[1];
};

// The failure value of the element routines.
constexpr UINT64 kPlistFailure = 0xFFFFFFFFFFFFFFFFULL;

extern PlistTag *gPlistFreeTags;
extern PlistSymbol *gPlistSymbols;

// The symbols' hash index: a tracked pool array of bucket heads, a power of
// two of them, kept while any symbol lives and grown as they multiply.
// Without it (no memory), the list is searched.
struct PlistSymbolIndex {
  PlistSymbol **buckets;
  UINT64 mask;        // bucket count - 1
  UINT64 count;       // symbols held
  PlistSymbol *list;  // gPlistSymbols when the index was last kept in step
};
extern PlistSymbolIndex gPlistSymbolIndex;

// All routines that take a text cut it in place: it must be writable and end
// with a zero byte. Offsets are counted from the text they are given.

// The first top-level dictionary; other top-level tags are parsed and
// released. EFI_NOT_FOUND when the text ends first (null in `dict`).
EFI_STATUS PlistParseDocument(char *text, PlistTag **dict);
// One element: the offset behind it and its tag, or null when it makes none.
// Containers and keys open at once are bounded (256); deeper nesting fails.
UINT64 PlistParseTag(char *text, PlistTag **tag);
// The contents of a container up to the first tag that makes no element
// (none when `empty` is set), in a new tag of `type`, children in reverse.
UINT64 PlistParseList(char *text, PlistTag **tag, UINT64 type, BOOLEAN empty);
// The value of the key of that name in a dictionary, or null.
PlistTag *PlistFindKey(PlistTag *tag, const char *key);
// Releases the tag, its children and every sibling behind it.
void PlistFreeTag(PlistTag *tag);
// The shared copy of `text`, with one more holder; Fatal without memory.
char *PlistInternSymbol(const char *text);
// The next `<...>`: its name, the offset of its `<` (if asked), and the offset
// behind the `>`, which is overwritten with a zero byte.
UINT64 PlistNextTag(char *text, char **name, UINT64 *tagStart);
// From behind an opening tag to behind the closing tag of `name`, whose `<`
// becomes the zero that ends the content.
UINT64 PlistCutContent(char *text, const char *name);
// A cleared record from the pool, or null when no block can be had.
PlistTag *PlistNewTag();

}  // namespace nimb
