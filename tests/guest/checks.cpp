#include "checks.h"

#include "devicetree.h"
#include "memory.h"
#include "memorymap.h"
#include "report.h"

namespace nimb::guest {

namespace {

// The gate's descriptor table: null, 32-bit code, flat data.
constexpr uint16_t kGdtLimit = 0x18;
constexpr uint64_t kGdtCode = 0x00CF9E000000FFFFull;
constexpr uint64_t kGdtData = 0x00CF92000000FFFFull;

constexpr char kMemoryMapPath[] = "/chosen/memory-map";
// The end node of a device path: type 0x7F, subtype 0xFF, length 4.
constexpr uint32_t kDevicePathEnd = 0x0004FF7F;

bool TextEqual(const char *a, const char *b) {
  while (*a != '\0' && *a == *b) {
    a++;
    b++;
  }
  return *a == *b;
}

bool StartsWith(const char *text, const char *prefix) {
  while (*prefix != '\0') {
    if (*text++ != *prefix++) {
      return false;
    }
  }
  return true;
}

uint32_t TextLength(const char *text, uint32_t limit) {
  uint32_t length = 0;
  while (length < limit && text[length] != '\0') {
    length++;
  }
  return length;
}

bool Inside(uint64_t start, uint64_t size, uint64_t low, uint64_t high) {
  return start >= low && start <= high && size <= high - start;
}

}  // namespace

KernelRegion KernelRegionOf(const BootArgs &args) {
  KernelRegion region;
  region.base = args.kernelRegionBase;
  region.end = static_cast<uint64_t>(args.kernelRegionBase) + args.kernelRegionSize;
  region.runtimeStart = static_cast<uint64_t>(args.runtimePageStart) * kPageSize;
  return region;
}

// --- the state at entry ----------------------------------------------------------

void CheckEntryState(const EntryState &s) {
  Line("entry eax=0x%x ebx=0x%x ecx=0x%x edx=0x%x esi=0x%x edi=0x%x ebp=0x%x esp=0x%x eflags=0x%x", s.eax,
       s.ebx, s.ecx, s.edx, s.esi, s.edi, s.ebp, s.esp, s.eflags);
  Line("entry cs=0x%x ds=0x%x es=0x%x fs=0x%x gs=0x%x ss=0x%x", s.cs, s.ds, s.es, s.fs, s.gs, s.ss);
  Line("entry cr0=0x%x cr3=0x%x cr4=0x%x efer=0x%llx gdt=0x%x limit=0x%x", s.cr0, s.cr3, s.cr4,
       static_cast<unsigned long long>(s.eferHigh) << 32 | s.eferLow, s.gdtBase, s.gdtLimit);

  Check("entry-eax-ebx", s.eax == s.ebx, "eax=0x%x ebx=0x%x", s.eax, s.ebx);
  Check("entry-edi", s.edi == s.entryAddress, "edi=0x%x, entry at 0x%x", s.edi, s.entryAddress);
  Check("entry-ecx", s.ecx == kEntryEcx, "ecx=0x%x, wanted 0x%x", s.ecx, kEntryEcx);
  Check("entry-cs", s.cs == kCodeSelector, "cs=0x%x, wanted 0x%x", s.cs, kCodeSelector);
  bool dataOk =
      s.ds == kDataSelector && s.es == kDataSelector && s.fs == kDataSelector && s.gs == kDataSelector;
  Check("entry-data-segments", dataOk, "ds=0x%x es=0x%x fs=0x%x gs=0x%x, wanted 0x%x", s.ds, s.es, s.fs, s.gs,
        kDataSelector);
  Check("entry-cr0", (s.cr0 & kCr0Pe) != 0 && (s.cr0 & kCr0Pg) == 0, "cr0=0x%x: PE %s, PG %s", s.cr0,
        (s.cr0 & kCr0Pe) != 0 ? "set" : "clear", (s.cr0 & kCr0Pg) != 0 ? "set" : "clear");
  Check("entry-efer", (s.eferLow & (kEferLme | kEferLma)) == 0, "efer=0x%x: LME %s, LMA %s", s.eferLow,
        (s.eferLow & kEferLme) != 0 ? "set" : "clear", (s.eferLow & kEferLma) != 0 ? "set" : "clear");
  Check("entry-interrupts", (s.eflags & kEflagsIf) == 0, "eflags=0x%x: IF %s", s.eflags,
        (s.eflags & kEflagsIf) != 0 ? "set" : "clear");

  const uint8_t *gdt = GuestMemory(s.gdtBase, kGdtLimit);
  if (gdt == nullptr || s.gdtLimit != kGdtLimit) {
    Check("entry-gdt", false, "limit=0x%x at 0x%x, wanted limit 0x%x%s", s.gdtLimit, s.gdtBase, kGdtLimit,
          gdt == nullptr ? " (unreadable)" : "");
    return;
  }
  uint64_t null = Le64(gdt), code = Le64(gdt + 8), data = Le64(gdt + 16);
  Check("entry-gdt", null == 0 && code == kGdtCode && data == kGdtData,
        "0x00=0x%llx 0x08=0x%llx 0x10=0x%llx, wanted 0, 0x%llx, 0x%llx",
        static_cast<unsigned long long>(null), static_cast<unsigned long long>(code),
        static_cast<unsigned long long>(data), static_cast<unsigned long long>(kGdtCode),
        static_cast<unsigned long long>(kGdtData));
}

// --- the boot record --------------------------------------------------------------

const BootArgs *CheckBootArgs(uint32_t address) {
  const uint8_t *bytes = GuestMemory(address, sizeof(BootArgs));
  if (!Check("bootargs-address", bytes != nullptr && address % kPageSize == 0, "0x%x%s", address,
             bytes == nullptr           ? ": unreadable"
             : address % kPageSize != 0 ? ": not a page"
                                        : "")) {
    if (bytes == nullptr) {
      return nullptr;
    }
  }
  const BootArgs &a = *reinterpret_cast<const BootArgs *>(bytes);

  Line("bootargs revision=%u", a.revision);
  Line("bootargs version=%u", a.version);
  LineStart();
  Print("bootargs commandLine=");
  PrintQuoted(a.commandLine, sizeof(a.commandLine));
  LineEnd();
  Line("bootargs memoryMap=0x%x", a.memoryMap);
  Line("bootargs memoryMapSize=0x%x", a.memoryMapSize);
  Line("bootargs memoryDescriptorSize=%u", a.memoryDescriptorSize);
  Line("bootargs memoryDescriptorVersion=%u", a.memoryDescriptorVersion);
  Line("bootargs videoBaseAddress=0x%x", a.videoBaseAddress);
  Line("bootargs videoDisplayMode=%u", a.videoDisplayMode);
  Line("bootargs videoRowBytes=%u", a.videoRowBytes);
  Line("bootargs videoWidth=%u", a.videoWidth);
  Line("bootargs videoHeight=%u", a.videoHeight);
  Line("bootargs videoDepth=%u", a.videoDepth);
  Line("bootargs deviceTree=0x%x", a.deviceTree);
  Line("bootargs deviceTreeLength=0x%x", a.deviceTreeLength);
  Line("bootargs kernelRegionBase=0x%x", a.kernelRegionBase);
  Line("bootargs kernelRegionSize=0x%x", a.kernelRegionSize);
  Line("bootargs runtimePageStart=0x%x", a.runtimePageStart);
  Line("bootargs runtimePageCount=0x%x", a.runtimePageCount);
  Line("bootargs systemTable=0x%x", a.systemTable);
  Line("bootargs firmwareBits=0x%x", a.firmwareBits);

  Check("bootargs-revision", a.revision == kBootArgsRevision, "%u, wanted %u", a.revision, kBootArgsRevision);
  Check("bootargs-version", a.version == kBootArgsVersion, "%u, wanted %u", a.version, kBootArgsVersion);
  Check("bootargs-firmware-bits", a.firmwareBits == kFirmwareBits, "0x%x, wanted 0x%x", a.firmwareBits,
        kFirmwareBits);
  uint32_t nonZero = 0;
  for (uint8_t byte : a.reserved) {
    nonZero += byte != 0;
  }
  Check("bootargs-reserved", nonZero == 0, "%u of %u reserved bytes not zero", nonZero,
        static_cast<uint32_t>(sizeof(a.reserved)));
  uint32_t commandLength = TextLength(a.commandLine, sizeof(a.commandLine));
  Check("bootargs-command-line", commandLength < sizeof(a.commandLine), "%u bytes%s", commandLength,
        commandLength < sizeof(a.commandLine) ? "" : ", no NUL in the field");

  // A frame buffer, or none at all; the mode says graphics or text.
  bool modeOk = a.videoDisplayMode == kDisplayModeGraphics || a.videoDisplayMode == kDisplayModeText;
  bool videoOk;
  if (a.videoBaseAddress == 0) {
    videoOk = (a.videoRowBytes | a.videoWidth | a.videoHeight | a.videoDepth) == 0;
  } else {
    uint64_t rowBits = static_cast<uint64_t>(a.videoWidth) * a.videoDepth;
    videoOk = a.videoWidth != 0 && a.videoHeight != 0 && a.videoDepth != 0 &&
              static_cast<uint64_t>(a.videoRowBytes) * 8 >= rowBits;
  }
  Check("bootargs-video", modeOk && videoOk, "mode %u, %ux%u, depth %u, %u bytes a row at 0x%x%s",
        a.videoDisplayMode, a.videoWidth, a.videoHeight, a.videoDepth, a.videoRowBytes, a.videoBaseAddress,
        !modeOk    ? ": mode neither 1 nor 2"
        : !videoOk ? ": dimensions don't fit the frame buffer"
                   : "");

  // The runtime area sits at the top of the kernel region, two spare pages
  // at its end.
  KernelRegion region = KernelRegionOf(a);
  bool areaOk = a.runtimePageCount >= 2 && region.runtimeStart >= region.base &&
                region.end <= 0x100000000ull &&
                region.runtimeStart + static_cast<uint64_t>(a.runtimePageCount) * kPageSize == region.end;
  Check("bootargs-runtime-area", areaOk, "pages 0x%x+0x%x, kernel region 0x%x+0x%x", a.runtimePageStart,
        a.runtimePageCount, a.kernelRegionBase, a.kernelRegionSize);
  return &a;
}

// --- the device tree -----------------------------------------------------------------

namespace {

struct NameCount {
  uint32_t unnamed;
  const char *rootName;
};

void CountNames(void *context, const TreeNode &node) {
  NameCount *count = static_cast<NameCount *>(context);
  if (node.depth == 0) {
    count->rootName = node.name;
  }
  count->unnamed += node.name == nullptr;
}

// The property as the given text with its NUL.
bool PropertyIsText(const uint8_t *tree, uint32_t length, const char *path, const char *name,
                    const char *text) {
  TreeProperty property;
  if (!TreeFindProperty(tree, length, path, name, &property)) {
    return false;
  }
  uint32_t i = 0;
  for (; text[i] != '\0'; i++) {
    if (i >= property.length || property.value[i] != static_cast<uint8_t>(text[i])) {
      return false;
    }
  }
  return property.length == i + 1 && property.value[i] == 0;
}

bool PropertyHasLength(const uint8_t *tree, uint32_t length, const char *path, const char *name,
                       uint32_t wanted) {
  TreeProperty property;
  return TreeFindProperty(tree, length, path, name, &property) && property.length == wanted;
}

}  // namespace

bool CheckDeviceTree(const BootArgs &args) {
  uint32_t length = args.deviceTreeLength;
  const uint8_t *tree = length != 0 ? GuestMemory(args.deviceTree, length) : nullptr;
  if (tree == nullptr) {
    Check("tree-walk", false, "%u bytes at 0x%x can't be read", length, args.deviceTree);
    return false;
  }
  TreeWalkResult walk = TreePrint(tree, length);
  if (!Check("tree-walk", walk.status == kTreeOk, "%u nodes, %u properties, 0x%x of 0x%x bytes%s%s",
             walk.nodes, walk.properties, walk.offset, length, walk.status == kTreeOk ? "" : ": ",
             walk.status == kTreeOk ? "" : TreeStatusText(walk.status))) {
    return false;
  }

  NameCount names = {0, nullptr};
  TreeWalk(tree, length, TreeVisitor{CountNames, nullptr}, &names);
  bool rootOk = names.rootName != nullptr && TextEqual(names.rootName, "/");
  Check("tree-names", names.unnamed == 0 && rootOk, "%u nodes without a name, root named %s", names.unnamed,
        names.rootName != nullptr ? names.rootName : "(null)");

  bool rootContent = PropertyIsText(tree, length, "/", "compatible", "ACPI") &&
                     PropertyIsText(tree, length, "/", "model", "ACPI");
  Check("tree-root", rootContent, "/ compatible and model %s \"ACPI\"", rootContent ? "are" : "are not both");

  // The command line stands in /chosen as it stands in the record.
  TreeProperty bootArgs;
  bool found = TreeFindProperty(tree, length, "/chosen", "boot-args", &bootArgs);
  uint32_t commandLength = TextLength(args.commandLine, sizeof(args.commandLine));
  bool same = found && bootArgs.length == commandLength + 1 && bootArgs.value[commandLength] == 0;
  for (uint32_t i = 0; same && i < commandLength; i++) {
    same = bootArgs.value[i] == static_cast<uint8_t>(args.commandLine[i]);
  }
  Check("tree-boot-args", same, "/chosen boot-args %s",
        !found ? "missing"
        : same ? "is the command line"
               : "differs from the command line");

  // Every boot names its kernel file and its boot device.
  TreeProperty bootFile, devicePath;
  bool fileOk =
      TreeFindProperty(tree, length, "/chosen", "boot-file", &bootFile) && bootFile.length >= 2 &&
      bootFile.value[bootFile.length - 1] == 0 &&
      TextLength(reinterpret_cast<const char *>(bootFile.value), bootFile.length) == bootFile.length - 1;
  bool pathOk = TreeFindProperty(tree, length, "/chosen", "boot-device-path", &devicePath) &&
                devicePath.length >= 4 && Le32(devicePath.value + devicePath.length - 4) == kDevicePathEnd;
  Check("tree-chosen", fileOk && pathOk, "boot-file %s, boot-device-path %s",
        fileOk ? "is a name" : "missing or not a text",
        pathOk ? "ends in an end node" : "missing or unterminated");

  bool efiOk = PropertyIsText(tree, length, "/efi", "firmware-abi", "EFI64") &&
               PropertyHasLength(tree, length, "/efi", "firmware-revision", 4) &&
               PropertyHasLength(tree, length, "/efi/runtime-services", "table", 8);
  Check("tree-efi", efiOk, "/efi firmware-abi \"EFI64\", firmware-revision and runtime-services table %s",
        efiOk ? "present" : "not all as wanted");
  return true;
}

// --- the ranges of /chosen/memory-map ------------------------------------------------------

namespace {

struct RangeList {
  Area *areas;
  uint32_t *count;
  uint32_t malformed;  // entries without 8 bytes of value
  bool nodeSeen;
};

void CollectNode(void *context, const TreeNode &node) {
  RangeList *list = static_cast<RangeList *>(context);
  list->nodeSeen |= TextEqual(node.path, kMemoryMapPath);
}

void CollectRange(void *context, const TreeNode &node, const TreeProperty &property) {
  RangeList *list = static_cast<RangeList *>(context);
  if (!TextEqual(node.path, kMemoryMapPath) || TextEqual(property.name, "name")) {
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

// --- the firmware's tables -------------------------------------------------------------

void CheckSystemTable(const BootArgs &args, const KernelRegion &region) {
  const uint8_t *table = GuestMemory(args.systemTable, kSystemTableSize);
  uint64_t signature = table != nullptr ? Le64(table) : 0;
  bool inArea = Inside(args.systemTable, kSystemTableSize, region.runtimeStart, region.end);
  if (!Check("efi-system-table", signature == kSystemTableSignature,
             "at 0x%x%s: signature 0x%llx, wanted 0x%llx", args.systemTable,
             inArea ? " (in the runtime area)" : "", static_cast<unsigned long long>(signature),
             static_cast<unsigned long long>(kSystemTableSignature))) {
    return;
  }
  uint64_t runtime = Le64(table + kSystemTableRuntimeServices);
  Line(
      "efi systemTable=0x%x revision=0x%x runtimeServices=0x%llx bootServices=0x%llx "
      "numberOfTableEntries=%u configurationTable=0x%llx",
      args.systemTable, Le32(table + kTableRevision), static_cast<unsigned long long>(runtime),
      static_cast<unsigned long long>(Le64(table + kSystemTableBootServices)),
      static_cast<uint32_t>(Le64(table + kSystemTableNumberOfTableEntries)),
      static_cast<unsigned long long>(Le64(table + kSystemTableConfigurationTable)));

  // A 64-bit pointer, of which a 32-bit kernel can follow only the low half.
  uint32_t address = static_cast<uint32_t>(runtime);
  const uint8_t *services = runtime >> 32 == 0 ? GuestMemory(address, kRuntimeServicesHeaderSize) : nullptr;
  uint64_t servicesSignature = services != nullptr ? Le64(services) : 0;
  bool servicesInArea = Inside(address, kRuntimeServicesHeaderSize, region.runtimeStart, region.end);
  Check("efi-runtime-services", servicesSignature == kRuntimeServicesSignature,
        "at 0x%llx%s: signature 0x%llx, wanted 0x%llx", static_cast<unsigned long long>(runtime),
        runtime >> 32 != 0 ? " (above 4 GiB)"
        : servicesInArea   ? " (in the runtime area)"
                           : "",
        static_cast<unsigned long long>(servicesSignature),
        static_cast<unsigned long long>(kRuntimeServicesSignature));
}

// --- all of it ------------------------------------------------------------------------

bool ReportBoot(const EntryState &state) {
  Line("start");
  CheckEntryState(state);
  const BootArgs *args = CheckBootArgs(state.eax);
  if (args != nullptr) {
    KernelRegion region = KernelRegionOf(*args);
    Area areas[kMaxAreas];
    uint32_t count = 0;
    areas[count++] = Area{"kernel image", state.imageStart, state.imageEnd - state.imageStart};
    areas[count++] = Area{"BootArgs", state.eax, static_cast<uint32_t>(sizeof(BootArgs))};
    areas[count++] = Area{"device tree", args->deviceTree, args->deviceTreeLength};
    areas[count++] = Area{"memory map", args->memoryMap, args->memoryMapSize};
    uint32_t fixedCount = count;
    if (CheckDeviceTree(*args)) {
      CheckMemoryRanges(*args, region, areas, &count);
    }
    CheckLayout(region, areas, count, fixedCount);
    CheckMemoryMap(*args, region, areas, count);
    CheckSystemTable(*args, region);
  }
  return ReportResult();
}

}  // namespace nimb::guest
