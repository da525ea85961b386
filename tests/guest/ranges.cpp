// The ranges of /chosen/memory-map, and where everything handed over lies.
#include "checks.h"
#include "devicetree.h"
#include "memory.h"
#include "report.h"
#include "text.h"

namespace nimb::guest {

namespace {

struct RangeList {
  Area *areas;
  uint32_t *count;
  uint32_t malformed;  // entries without 8 bytes of value
  bool nodeSeen;
};

void CollectNode(void *context, const TreeNode &node) {
  RangeList *list = static_cast<RangeList *>(context);
  list->nodeSeen |= TextEqual(node.path, kTreeMemoryMapPath);
}

void CollectRange(void *context, const TreeNode &node, const TreeProperty &property) {
  RangeList *list = static_cast<RangeList *>(context);
  if (!TextEqual(node.path, kTreeMemoryMapPath) || TextEqual(property.name, "name")) {
    return;
  }
  if (property.length != 8) {
    list->malformed++;
    return;
  }
  if (*list->count < kMaxAreas) {
    list->areas[(*list->count)++] = Area{property.name, Le32(property.value), Le32(property.value + 4)};
  }
}

// The hexadecimal number behind `prefix` in `name` equals `address`.
bool NameCarriesAddress(const char *name, const char *prefix, uint32_t address) {
  const char *digits = name;
  while (*prefix != '\0') {
    digits++;
    prefix++;
  }
  if (*digits == '\0') {
    return false;
  }
  uint64_t value = 0;
  for (; *digits != '\0'; digits++) {
    char c = *digits;
    uint32_t digit = c >= '0' && c <= '9'   ? static_cast<uint32_t>(c - '0')
                     : c >= 'a' && c <= 'f' ? static_cast<uint32_t>(c - 'a' + 10)
                     : c >= 'A' && c <= 'F' ? static_cast<uint32_t>(c - 'A' + 10)
                                            : 16;
    if (digit == 16 || value >> 60 != 0) {
      return false;
    }
    value = value << 4 | digit;
  }
  return static_cast<uint32_t>(value) == address;
}

const Area *FindArea(const Area *areas, uint32_t first, uint32_t count, const char *name) {
  for (uint32_t i = first; i < count; i++) {
    if (TextEqual(areas[i].name, name)) {
      return &areas[i];
    }
  }
  return nullptr;
}

}  // namespace

void CheckMemoryRanges(const BootArgs &args, const KernelRegion &region, Area *areas, uint32_t *count) {
  uint32_t first = *count;
  RangeList list = {areas, count, 0, false};
  TreeWalk(GuestMemory(args.deviceTree, args.deviceTreeLength), args.deviceTreeLength,
           TreeVisitor{CollectNode, CollectRange}, &list);
  for (uint32_t i = first; i < *count; i++) {
    Line("range %s address=0x%x length=0x%x", areas[i].name, areas[i].address, areas[i].length);
  }
  Check("ranges-entries", list.nodeSeen && list.malformed == 0, "%u ranges, %u entries without 8 bytes%s",
        *count - first, list.malformed, list.nodeSeen ? "" : ", no /chosen/memory-map");

  const Area *outside = nullptr;
  const Area *misnamed = nullptr;
  for (uint32_t i = first; i < *count; i++) {
    const Area &area = areas[i];
    if (outside == nullptr && !Inside(area.address, area.length, region.base, region.runtimeStart)) {
      outside = &area;
    }
    bool named = true;
    if (StartsWith(area.name, "DriversPackage-")) {
      named = NameCarriesAddress(area.name, "DriversPackage-", area.address);
    } else if (StartsWith(area.name, "Driver-")) {
      named = NameCarriesAddress(area.name, "Driver-", area.address);
    }
    if (misnamed == nullptr && !named) {
      misnamed = &area;
    }
  }
  if (outside != nullptr) {
    Check("ranges-inside", false, "%s at 0x%x+0x%x lies outside 0x%llx-0x%llx", outside->name,
          outside->address, outside->length, static_cast<unsigned long long>(region.base),
          static_cast<unsigned long long>(region.runtimeStart));
  } else {
    Check("ranges-inside", true, "all in 0x%llx-0x%llx", static_cast<unsigned long long>(region.base),
          static_cast<unsigned long long>(region.runtimeStart));
  }
  if (misnamed != nullptr) {
    Check("ranges-names", false, "%s is at 0x%x", misnamed->name, misnamed->address);
  } else {
    Check("ranges-names", true, "driver ranges named by their addresses");
  }

  const Area *clut = FindArea(areas, first, *count, "BootCLUT");
  Check("range-boot-clut", clut != nullptr && clut->length == kBootClutLength, "length 0x%x, wanted 0x%x",
        clut != nullptr ? clut->length : 0, kBootClutLength);

  const Area *picture = FindArea(areas, first, *count, "Pict-FailedBoot");
  const uint8_t *record = picture != nullptr && picture->length == kFailedBootLength
                              ? GuestMemory(picture->address, picture->length)
                              : nullptr;
  uint32_t width = record != nullptr ? Le32(record) : 0;
  uint32_t height = record != nullptr ? Le32(record + 4) : 0;
  uint32_t zero = record != nullptr ? Le32(record + 8) : 0;
  Check("range-failed-boot",
        record != nullptr && width == kFailedBootWidth && height == kFailedBootHeight && zero == 0,
        "length 0x%x, picture %ux%u, word 0x%x; wanted 0x%x, %ux%u, 0",
        picture != nullptr ? picture->length : 0, width, height, zero, kFailedBootLength, kFailedBootWidth,
        kFailedBootHeight);
}

// --- where everything lies ---------------------------------------------------------

void CheckLayout(const KernelRegion &region, const Area *areas, uint32_t count, uint32_t fixedCount) {
  for (uint32_t i = 0; i < fixedCount; i++) {
    if (!Inside(areas[i].address, areas[i].length, region.base, region.runtimeStart)) {
      Check("region-layout", false, "%s at 0x%x+0x%x lies outside 0x%llx-0x%llx", areas[i].name,
            areas[i].address, areas[i].length, static_cast<unsigned long long>(region.base),
            static_cast<unsigned long long>(region.runtimeStart));
      return;
    }
  }
  for (uint32_t i = 0; i < count; i++) {
    for (uint32_t j = i + 1; j < count; j++) {
      uint64_t iEnd = static_cast<uint64_t>(areas[i].address) + areas[i].length;
      uint64_t jEnd = static_cast<uint64_t>(areas[j].address) + areas[j].length;
      if (areas[i].address < jEnd && areas[j].address < iEnd) {
        Check("region-layout", false, "%s at 0x%x+0x%x overlaps %s at 0x%x+0x%x", areas[i].name,
              areas[i].address, areas[i].length, areas[j].name, areas[j].address, areas[j].length);
        return;
      }
    }
  }
  Check("region-layout", true, "%u areas apart from each other below the runtime area at 0x%llx", count,
        static_cast<unsigned long long>(region.runtimeStart));
}

}  // namespace nimb::guest
