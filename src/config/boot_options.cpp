#include "config/boot_options.h"

#include "boot/boot.h"
#include "config/options.h"
#include "config/plist.h"
#include "efi/vendor.h"
#include "load/bootfile.h"
#include "memory/tracking.h"
#include "screen/console.h"
#include "support/devicepath.h"
#include "support/sprint.h"
#include "support/strings.h"
#include "support/text.h"

namespace nimb {

UINT64 gBootFlags;
char *gBootOptions;
PlistTag *gConfigDict;
const CHAR16 *gKernelName;
EFI_DEVICE_PATH_PROTOCOL *gKernelDevicePath;
const CHAR16 *gDriverPackageName;
EFI_DEVICE_PATH_PROTOCOL *gDriverPackagePath;
UINT8 gCustomDriverPackage;

// The configuration file's name: 1024 wide characters.
constexpr UINTN kConfigNameBytes = 2048;
// The driver package's name on a network boot, made from the kernel's.
static CHAR16 gNetworkDriverPackageName[1024];

static const char kConfigDirectory[] = "Library\\Preferences\\SystemConfiguration\\";
static const char kConfigSuffix[] = ".plist";

static bool IsOptionBlank(CHAR16 c) {
  return c == u' ' || c == u'\t' || c == u'\r' || c == u'\n';
}

// A first word that is a file path (the loader's own name, as some firmware
// passes it) is no option: it is stripped.
static const CHAR16 *StripFilePath(const CHAR16 *options) {
  const CHAR16 *p = options;
  while (IsOptionBlank(*p)) {
    p++;
  }
  bool letter = (*p >= u'A' && *p <= u'Z') || (*p >= u'a' && *p <= u'z');
  if (!letter && *p != u'/' && *p != u'\\') {
    return options;
  }
  while (*p != 0 && *p != u'=' && !IsOptionBlank(*p)) {
    p++;
  }
  if (*p == u'=') {
    return options;
  }
  return *p == 0 ? p : p + 1;
}

// Asks the boot policy whether the keys held at start are to be ignored.
static void ReadBootPolicy() {
  NIMB_BOOT_POLICY_PROTOCOL *policy = nullptr;
  if (!EFI_ERROR(
          gBS->LocateProtocol(&gNimbBootPolicyProtocolGuid, nullptr, reinterpret_cast<void **>(&policy))) &&
      policy != nullptr) {
    UINT64 ignored = 0;
    policy->GetKeysIgnored(policy, &ignored);
    if (ignored != 0) {
      gBootFlags |= kBootKeysIgnored;
    }
  }
}

// Safe mode, verbose or single-user from the keys held at start.
static void ReadKeyState() {
  NIMB_KEY_STATE_PROTOCOL *keyState = nullptr;
  if (EFI_ERROR(
          gBS->LocateProtocol(&gNimbKeyStateProtocolGuid, nullptr, reinterpret_cast<void **>(&keyState))) ||
      keyState == nullptr || (gBootFlags & kBootKeysIgnored) != 0) {
    return;
  }
  UINT16 modifiers = 0;
  UINT16 keys[32];
  UINTN count = 32;
  if (EFI_ERROR(keyState->ReadKeyState(keyState, &modifiers, &count, keys))) {
    return;
  }
  const UINT16 shift = kKeyModifierLeftShift | kKeyModifierRightShift;
  const UINT16 gui = kKeyModifierLeftGui | kKeyModifierRightGui;
  if ((modifiers & shift) != 0 && (modifiers & ~shift) == 0 && count == 0) {
    gBootFlags |= kBootSafeMode;
  }
  if ((modifiers & gui) != 0 && count == 1) {
    if (keys[0] == kKeyV) {
      gBootFlags |= kBootVerbose;
    } else if (keys[0] == kKeyS) {
      gBootFlags |= kBootSingleUser;
    }
  }
}

// The vendor's NVRAM variable `name` into tracked pool; null when it is not
// there or cannot be read. With `terminate`, a zero byte follows its bytes.
static UINT8 *ReadVariable(const CHAR16 *name, bool terminate, UINTN *size, bool *outOfMemory) {
  *outOfMemory = false;
  UINTN length = 0;
  if (gRT->GetVariable(name, &gNimbVendorVariableGuid, nullptr, &length, nullptr) != EFI_BUFFER_TOO_SMALL) {
    return nullptr;
  }
  UINT8 *data = static_cast<UINT8 *>(TrackedAllocatePool(length + (terminate ? 1 : 0)));
  if (data == nullptr) {
    *outOfMemory = true;
    return nullptr;
  }
  if (EFI_ERROR(gRT->GetVariable(name, &gNimbVendorVariableGuid, nullptr, &length, data))) {
    TrackedFree(data);
    return nullptr;
  }
  if (terminate) {
    data[length] = 0;
  }
  *size = length;
  return data;
}

EFI_DEVICE_PATH_PROTOCOL *GetDevicePathVariable(const CHAR16 *name, BOOLEAN wantMac) {
  bool outOfMemory = false;
  UINTN size = 0;
  UINT8 *data = ReadVariable(name, false, &size, &outOfMemory);
  if (data == nullptr) {
    return nullptr;
  }
  // A path that does not end within the variable, or that has a node of
  // length 0, is taken for no path at all: the walk looks for a MAC address
  // node, and every later walk of the path (which knows nothing of the
  // variable's size) needs its end inside the variable, behind a MAC node
  // as well.
  const EFI_DEVICE_PATH_PROTOCOL *path = reinterpret_cast<const EFI_DEVICE_PATH_PROTOCOL *>(data);
  const bool mac = DevicePathFindNode(path, size, MESSAGING_DEVICE_PATH, MSG_MAC_ADDR_DP) != nullptr;
  if (DevicePathSizeWithin(path, size) == 0 || mac != (wantMac != 0)) {
    TrackedFree(data);
    return nullptr;
  }
  return reinterpret_cast<EFI_DEVICE_PATH_PROTOCOL *>(data);
}

EFI_DEVICE_PATH_PROTOCOL *MakeFileDevicePath(const EFI_DEVICE_PATH_PROTOCOL *path, const CHAR16 *name,
                                             BOOLEAN replaceLast) {
  UINTN pathSize = DevicePathSize(path);
  if (pathSize == 0 || name == nullptr) {
    return nullptr;
  }
  UINT64 nameUnits = StrLen(name);
  UINTN capacity = pathSize + 2 * nameUnits + 2;
  UINT8 *copy = static_cast<UINT8 *>(TrackedAllocatePool(capacity));
  if (copy == nullptr) {
    return nullptr;
  }
  UINTN remaining = pathSize;
  const EFI_DEVICE_PATH_PROTOCOL *node = DevicePathFirstNode(path, &remaining);
  UINTN written = 0;
  while (node != nullptr && !IsDevicePathEnd(node) &&
         !(DevicePathNodeType(node) == MEDIA_DEVICE_PATH && node->SubType == MEDIA_FILEPATH_DP)) {
    UINT16 length = DevicePathNodeLength(node);
    memcpy(copy + written, node, length);
    written += length;
    node = DevicePathNextNode(node, &remaining);
  }
  if (node == nullptr || IsDevicePathEnd(node)) {
    TrackedFree(copy);
    return nullptr;
  }

  // The old node's text, unit by unit (nodes are not aligned), up to its
  // terminator or the node's end.
  const UINT8 *oldText = reinterpret_cast<const UINT8 *>(node) + kDevicePathNodeHeadSize;
  UINTN oldUnits = (DevicePathNodeLength(node) - kDevicePathNodeHeadSize) / 2;
  UINT8 *nodeStart = copy + written;
  UINT8 *text = nodeStart + kDevicePathNodeHeadSize;
  UINTN units = 0;
  UINTN afterSeparator = 0;
  for (; units < oldUnits; units++) {
    UINT16 unit = static_cast<UINT16>(oldText[2 * units] | (oldText[2 * units + 1] << 8));
    if (unit == 0) {
      break;
    }
    text[2 * units] = oldText[2 * units];
    text[2 * units + 1] = oldText[2 * units + 1];
    if (unit == u'\\' || unit == u'/') {
      afterSeparator = units + 1;
    }
  }
  if (replaceLast) {
    units = afterSeparator;
  }
  for (UINT64 i = 0; i <= nameUnits; i++, units++) {
    text[2 * units] = static_cast<UINT8>(name[i] & 0xFF);
    text[2 * units + 1] = static_cast<UINT8>(name[i] >> 8);
  }
  UINTN nodeLength = kDevicePathNodeHeadSize + 2 * units;
  if (nodeLength > 0xFFFF) {
    TrackedFree(copy);
    return nullptr;
  }
  nodeStart[0] = MEDIA_DEVICE_PATH;
  nodeStart[1] = MEDIA_FILEPATH_DP;
  nodeStart[2] = static_cast<UINT8>(nodeLength & 0xFF);
  nodeStart[3] = static_cast<UINT8>(nodeLength >> 8);
  UINT8 *end = nodeStart + nodeLength;
  end[0] = END_DEVICE_PATH_TYPE;
  end[1] = END_ENTIRE_DEVICE_PATH_SUBTYPE;
  end[2] = 4;
  end[3] = 0;
  return reinterpret_cast<EFI_DEVICE_PATH_PROTOCOL *>(copy);
}

// The configuration file's name into `name` (1024 wide characters). A
// `config` value names the file: relative to the preferences directory, or
// as given when it starts with a separator, with ".plist" behind it. False
// when the name would not fit: then no configuration file is read.
static bool MakeConfigName(const char *loadOptions, EFI_LOAD_FILE_INTERFACE *loadFile, CHAR16 *name) {
  const char *value = nullptr;
  UINT64 length = 0;
  if (EFI_ERROR(GetOptionValue(loadOptions, "config", &value, &length))) {
    StrCpy(name, loadFile != nullptr ? kDefaultNetworkConfigName : kDefaultConfigName);
    return true;
  }
  bool absolute = length > 0 && (value[0] == '/' || value[0] == '\\');
  const char *prefix = absolute ? "" : kConfigDirectory;
  UINT64 units = strlen(prefix) + length + strlen(kConfigSuffix);
  if (units + 1 > kConfigNameBytes / sizeof(CHAR16)) {
    return false;
  }
  // Each byte becomes one character: no UTF-8 decoding, separators kept.
  CHAR16 *write = name;
  for (const char *p = prefix; *p != 0; p++) {
    *write++ = static_cast<UINT8>(*p);
  }
  for (UINT64 i = 0; i < length; i++) {
    *write++ = static_cast<UINT8>(value[i]);
  }
  for (const char *p = kConfigSuffix; *p != 0; p++) {
    *write++ = static_cast<UINT8>(*p);
  }
  *write = 0;
  return true;
}

// Reads and parses the configuration file; null when there is none or it
// does not parse. The parser needs a zero byte behind the text and cuts the
// text in place; the dictionary keeps copies of all it holds.
static PlistTag *ReadConfiguration(EFI_LOAD_FILE_INTERFACE *loadFile, EFI_FILE *root, const CHAR16 *name) {
  UINT64 size = 0;
  UINT8 *contents = nullptr;
  if (EFI_ERROR(BootFileReadWhole(loadFile, root, name, nullptr, &size, &contents)) || contents == nullptr) {
    return nullptr;
  }
  char *text = static_cast<char *>(TrackedAllocatePool(size + 1));
  if (text != nullptr) {
    memcpy(text, contents, size);
    text[size] = 0;
  }
  TrackedFree(contents);
  if (text == nullptr) {
    return nullptr;
  }
  PlistTag *dict = nullptr;
  if (EFI_ERROR(PlistParseDocument(text, &dict))) {
    dict = nullptr;
  }
  TrackedFree(text);
  return dict;
}

// Appends every word of `text` that is not in the option string yet.
static char *AppendWords(OptionKeyIndex *index, char *end, const char *text) {
  while (*text != 0) {
    const char *word = nullptr;
    UINT64 keyLength = 0;
    UINT64 wordLength = 0;
    text = NextOption(text, &word, &keyLength, &wordLength);
    end = AppendIndexedOption(index, end, word, keyLength, wordLength);
  }
  return end;
}

// The final option string: the load options whole, then the words of NVRAM,
// of `Kernel Flags` and of the keys held, each dropped when its key is there
// already. Null when there is no memory for it.
static char *MergeOptions(const char *loadOptions, const char *nvram, const char *kernelFlags,
                          UINT64 snapshot) {
  const char *start = loadOptions;
  while (*start == ' ' || *start == '\t' || *start == '\r' || *start == '\n') {
    start++;
  }
  UINT64 size = strlen(start) + (nvram != nullptr ? strlen(nvram) : 0) +
                (kernelFlags != nullptr ? strlen(kernelFlags) : 0);
  char *merged = static_cast<char *>(TrackedAllocatePool(size + 64));
  if (merged == nullptr) {
    return nullptr;
  }
  strcpy(merged, start);
  char *end = merged + strlen(merged);
  // The words that may come: those of the three texts and the three flags.
  OptionKeyIndex index;
  OptionKeyIndexInit(&index, merged, size + 64,
                     CountOptionWords(start) + (nvram != nullptr ? CountOptionWords(nvram) : 0) +
                         (kernelFlags != nullptr ? CountOptionWords(kernelFlags) : 0) + 3);
  if (nvram != nullptr) {
    end = AppendWords(&index, end, nvram);
  }
  if (kernelFlags != nullptr) {
    end = AppendWords(&index, end, kernelFlags);
  }
  if (snapshot & kBootSafeMode) {
    printf("Using Safe Mode\n");
    end = AppendIndexedOption(&index, end, "-x", 2, 2);
  }
  if (snapshot & kBootSingleUser) {
    end = AppendIndexedOption(&index, end, "-s", 2, 2);
  }
  if (snapshot & kBootVerbose) {
    end = AppendIndexedOption(&index, end, "-v", 2, 2);
  }
  OptionKeyIndexFree(&index);
  return merged;
}

// True when `name` is the default kernel: one leading separator aside, the
// same characters with `/` and `\` counted as one.
static bool IsDefaultKernelName(const CHAR16 *name) {
  if (*name == u'/' || *name == u'\\') {
    name++;
  }
  const CHAR16 *reference = kDefaultKernelName;
  for (;; name++, reference++) {
    CHAR16 a = *name == u'/' ? u'\\' : *name;
    CHAR16 b = *reference == u'/' ? u'\\' : *reference;
    if (a != b) {
      return false;
    }
    if (a == 0) {
      return true;
    }
  }
}

static void ReplaceSlashes(CHAR16 *name) {
  for (; *name != 0; name++) {
    if (*name == u'/') {
      *name = u'\\';
    }
  }
}

// A value of the option string or the configuration dictionary as a new
// wide text; null when the key is absent or there is no memory.
static CHAR16 *WideOptionValue(const char *options, const char *key) {
  const char *value = nullptr;
  UINT64 length = 0;
  if (EFI_ERROR(GetOptionOrConfigValue(options, key, &value, &length))) {
    return nullptr;
  }
  return Utf8ToUcsAlloc(value, length);
}

EFI_STATUS ProcessBootOptions(EFI_LOAD_FILE_INTERFACE *loadFile, EFI_FILE *root, const CHAR16 *options,
                              char **bootOptions) {
  // 1-2. The load options, less a leading file path, as UTF-8.
  const CHAR16 *wide = StripFilePath(options != nullptr ? options : u"");
  UINT64 units = StrLen(wide);
  char *loadOptions = static_cast<char *>(TrackedAllocatePool(3 * units + 1));
  if (loadOptions == nullptr) {
    return EFI_OUT_OF_RESOURCES;
  }
  UcsToUtf8(reinterpret_cast<const UINT16 *>(wide), static_cast<INT32>(units),
            reinterpret_cast<UINT8 *>(loadOptions), static_cast<UINT32>(3 * units + 1), 1);

  // 3-6. Boot policy, safe mode asked for, held keys, the boot device.
  ReadBootPolicy();
  const char *ignored = nullptr;
  UINT64 ignoredLength = 0;
  if (!EFI_ERROR(GetOptionValue(loadOptions, "-x", &ignored, &ignoredLength))) {
    gBootFlags |= kBootSafeMode;
  }
  ReadKeyState();
  if (DevicePathFindNode(gBootDevicePath, kMaxDevicePathSize, MESSAGING_DEVICE_PATH, MSG_MAC_ADDR_DP) !=
      nullptr) {
    gBootFlags |= kBootNetwork;
  }
  BOOLEAN network = (gBootFlags & kBootNetwork) != 0;

  // 7-10. NVRAM, unless in safe mode, and the default paths of a network boot.
  char *nvram = nullptr;
  if ((gBootFlags & kBootSafeMode) == 0) {
    bool outOfMemory = false;
    UINTN size = 0;
    nvram = reinterpret_cast<char *>(ReadVariable(u"boot-args", true, &size, &outOfMemory));
    if (outOfMemory) {
      return EFI_OUT_OF_RESOURCES;
    }
    gKernelDevicePath = GetDevicePathVariable(u"efi-boot-file-data", network);
  }
  const EFI_DEVICE_PATH_PROTOCOL *imagePath = gLoadedImage != nullptr ? gLoadedImage->FilePath : nullptr;
  if (network && gKernelDevicePath == nullptr) {
    gKernelDevicePath = MakeFileDevicePath(imagePath, kDefaultNetworkKernelName, TRUE);
  }
  if ((gBootFlags & kBootSafeMode) == 0) {
    gDriverPackagePath = GetDevicePathVariable(u"efi-boot-drvpk-data", network);
  }
  if (network && gDriverPackagePath == nullptr) {
    gDriverPackagePath = gKernelDevicePath != nullptr
                             ? MakeFileDevicePath(gKernelDevicePath, u".drvpk", FALSE)
                             : MakeFileDevicePath(imagePath, u"nimb.tarnix.drvpk", TRUE);
  }

  // 11-12. The configuration file.
  CHAR16 *configName = static_cast<CHAR16 *>(TrackedAllocatePool(kConfigNameBytes));
  if (configName == nullptr) {
    return EFI_OUT_OF_RESOURCES;
  }
  const char *kernelFlags = nullptr;
  if (MakeConfigName(loadOptions, loadFile, configName)) {
    gConfigDict = ReadConfiguration(loadFile, root, configName);
    kernelFlags = GetConfigValue("Kernel Flags");
  }

  // 13-14. The final option string.
  UINT64 snapshot = gBootFlags;
  *bootOptions = MergeOptions(loadOptions, nvram, kernelFlags, snapshot);
  const char *final = *bootOptions != nullptr ? *bootOptions : "";

  // 15-16. Kernel and driver package names.
  CHAR16 *kernelName = WideOptionValue(final, "Kernel");
  if (kernelName != nullptr && !IsDefaultKernelName(kernelName)) {
    gBootFlags |= kBootOtherKernel;
  }
  CHAR16 *packageName = WideOptionValue(final, "Drvpk Cache");

  // 17-19.
  TrackedFree(loadOptions);
  if (kernelName == nullptr) {
    gKernelName = loadFile != nullptr ? kDefaultNetworkKernelName : kDefaultKernelName;
  } else {
    ReplaceSlashes(kernelName);
    gKernelName = kernelName;
  }
  if (packageName != nullptr) {
    gCustomDriverPackage = 1;
    ReplaceSlashes(packageName);
    gDriverPackageName = packageName;
  } else if (loadFile != nullptr) {
    SPrint(gNetworkDriverPackageName, sizeof(gNetworkDriverPackageName), u"%S.drvpk", gKernelName);
    gDriverPackageName = gNetworkDriverPackageName;
  } else {
    gDriverPackageName = kDefaultDriverPackageName;
  }

  // 20. The flags the final string asks for.
  if (!EFI_ERROR(GetOptionValue(final, "-v", &ignored, &ignoredLength))) {
    gBootFlags |= kBootVerbose;
  }
  if (!EFI_ERROR(GetOptionValue(final, "-x", &ignored, &ignoredLength))) {
    gBootFlags |= kBootSafeMode;
  }
  if (loadFile != nullptr) {
    gBootFlags |= kBootNetwork;
  }
  if (gBootFlags & kBootSingleUser) {
    gBootFlags |= kBootVerbose;
  }

  // 21.
  if (nvram != nullptr) {
    TrackedFree(nvram);
  }
  TrackedFree(configName);
  return EFI_SUCCESS;
}

}  // namespace nimb
