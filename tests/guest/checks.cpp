#include "checks.h"

#include "devicetree.h"
#include "drivers.h"
#include "memory.h"
#include "memorymap.h"
#include "report.h"
#include "text.h"

namespace nimb::guest {

namespace {

// The gate's descriptor table: null, 32-bit code, flat data. The processor
// sets a descriptor's accessed bit when it loads a selector of it, so that
// bit is left out of the comparison.
constexpr uint16_t kGdtLimit = 0x18;
constexpr uint64_t kGdtCode = 0x00CF9E000000FFFFull;
constexpr uint64_t kGdtData = 0x00CF92000000FFFFull;
constexpr uint64_t kGdtAccessed = 1ull << 40;

// The end node of a device path: type 0x7F, subtype 0xFF, length 4.
constexpr uint32_t kDevicePathEnd = 0x0004FF7F;

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
  // The time stamp counter at entry: the end of timings that the platform
  // layer starts (platform: tsc ... lines) in the same run.
  Line("tsc entry=0x%llx", static_cast<unsigned long long>(s.tscHigh) << 32 | s.tscLow);

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
  Check("entry-gdt", null == 0 && (code & ~kGdtAccessed) == kGdtCode && (data & ~kGdtAccessed) == kGdtData,
        "0x00=0x%llx 0x08=0x%llx 0x10=0x%llx, wanted 0, 0x%llx, 0x%llx",
        static_cast<unsigned long long>(null), static_cast<unsigned long long>(code),
        static_cast<unsigned long long>(data), static_cast<unsigned long long>(kGdtCode),
        static_cast<unsigned long long>(kGdtData));
}

// --- the boot record --------------------------------------------------------------

const BootArgs *CheckBootArgs(uint32_t address) {
  const uint8_t *bytes = GuestMemory(address, sizeof(BootArgs));
  bool aligned = address % kPageSize == 0;
  Check("bootargs-address", bytes != nullptr && aligned, "0x%x%s", address,
        bytes == nullptr ? ": unreadable"
        : !aligned       ? ": not at the start of a page"
                         : "");
  if (bytes == nullptr) {
    return nullptr;
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

// --- the firmware's tables -------------------------------------------------------------

void CheckSystemTable(const BootArgs &args, const KernelRegion &region) {
  CheckSystemTableAt(args.systemTable, region);
}

void CheckSystemTableAt(uint32_t systemTable, const KernelRegion &region) {
  const uint8_t *table = GuestMemory(systemTable, kSystemTableSize);
  uint64_t signature = table != nullptr ? Le64(table) : 0;
  bool inArea = Inside(systemTable, kSystemTableSize, region.runtimeStart, region.end);
  if (!Check("efi-system-table", signature == kSystemTableSignature,
             "at 0x%x%s: signature 0x%llx, wanted 0x%llx", systemTable,
             inArea ? " (in the runtime area)" : "", static_cast<unsigned long long>(signature),
             static_cast<unsigned long long>(kSystemTableSignature))) {
    return;
  }
  uint64_t runtime = Le64(table + kSystemTableRuntimeServices);
  Line(
      "efi systemTable=0x%x revision=0x%x runtimeServices=0x%llx bootServices=0x%llx "
      "numberOfTableEntries=%u configurationTable=0x%llx",
      systemTable, Le32(table + kTableRevision), static_cast<unsigned long long>(runtime),
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
      CheckDrivers(region, state.imageEnd, areas, fixedCount, count);
    }
    CheckLayout(region, areas, count, fixedCount);
    CheckMemoryMap(*args, region, areas, count);
    CheckSystemTable(*args, region);
  }
  return ReportResult();
}

}  // namespace nimb::guest
