// The platform layer: the program that the firmware starts from
// \EFI\BOOT\BOOTX64.EFI. It gives the firmware what the loader expects of
// the machines it was made for, starts the loader, reports how the loader
// came back, shows the outcome on the screen and ends the run: through
// QEMU's debug-exit device with an exit code that tells the outcome, or back
// to the firmware with the loader's status.
#include <stdarg.h>

#include "config.h"
#include "console_control.h"
#include "data_hub.h"
#include "device_properties.h"
#include "efi/vendor.h"
#include "ending.h"
#include "exitcodes.h"
#include "file_times.h"
#include "firmware.h"
#include "format.h"
#include "graphics.h"
#include "key_state.h"
#include "machine.h"
#include "memory.h"
#include "net_boot.h"
#include "net_boot_info.h"
#include "resume_watch.h"
#include "serial.h"
#include "tsc.h"

namespace nimb::platform {

namespace {

constexpr UINT16 kDebugExitPort = 0xF4;
constexpr const CHAR16 *kConfigPath = u"\\EFI\\BOOT\\platform.cfg";
constexpr const char *kConfigName = "platform.cfg";
constexpr const CHAR16 *kTimesPath = u"\\EFI\\BOOT\\platform.times";
constexpr const char *kTimesName = "platform.times";

PlatformConsole gConsole;
PlatformKeyState gKeyState;
PlatformBootPolicy gBootPolicy;
PlatformDataHub gDataHub;
PlatformDeviceProperties gDeviceProperties;
PlatformNetBootInfo gNetBootInfo;
PlatformNetBoot gNetBoot;
MemoryMeter gMeter;
FileTimeTable gTimes;

// How the run is to end, as far as it is known: by the machine alone until
// the configuration is read.
struct Ending {
  bool debugExit;
  bool waitKey;
  // The device whose file system serves exact times; null: none.
  EFI_HANDLE timedDevice;
  // Once the loader came back, its status, which the firmware gets back
  // whatever fails after it.
  bool loaderReturned;
  EFI_STATUS loaderStatus;
};
Ending gEnding;

void SetEnding(const PlatformConfig &config) {
  gEnding.debugExit = config.debugExit == kDebugExitAuto ? MachineIsQemu() : config.debugExit == kDebugExitOn;
  gEnding.waitKey = config.waitKey;
  SerialPrintf("platform: debug-exit %s\n", gEnding.debugExit ? "in use" : "not used");
}

// The outcome goes on a text screen; the loader's own mode changes alone
// show in the log.
void ScreenToText() {
  if (gConsole.protocol.SetMode != nullptr && gConsole.mode != EfiConsoleControlScreenText) {
    gConsole.onSetMode = nullptr;
    gConsole.protocol.SetMode(&gConsole.protocol, EfiConsoleControlScreenText);
  }
}

// Shows `outcome` on the screen, waits for a key when configured, then ends
// QEMU through the debug-exit device with `code`, when it is in use. Without
// one the write goes nowhere, and the platform goes back to the firmware
// with `status`, having put back and removed all that the firmware would
// otherwise call in the freed image.
[[noreturn]] void End(EFI_STATUS status, UINT8 code, const char *outcome) {
  ScreenToText();
  ShowOnScreen(outcome);
  if (gEnding.waitKey) {
    SerialPrintf("platform: waiting for a key\n");
    SerialPrintf("platform: %s\n",
                 WaitForKeyPress("Press a key to go on.") ? "key pressed" : "no keyboard to wait for");
  }
  SerialPrintf("platform: exit code 0x%x\n", static_cast<UINT64>(code));
  if (gEnding.debugExit) {
    PortWriteByte(kDebugExitPort, code);
  }
  UnwatchDiskAndReset();
  if (gEnding.timedDevice != nullptr) {
    FileTimesUninstall(gEnding.timedDevice);
  }
  const UINTN givenBack = ProtocolsGiveBack();
  if (givenBack != 0) {
    SerialPrintf("platform: %u of the firmware's own protocols put back\n", static_cast<UINT64>(givenBack));
  }
  const UINTN removed = UninstallOwnInterfaces();
  SerialPrintf("platform: %u interfaces removed; back to the firmware with %s\n",
               static_cast<UINT64>(removed), StatusName(status));
  gBS->Exit(gImageHandle, status, 0, nullptr);
  for (;;) {
    __asm__ volatile("hlt");
  }
}

[[noreturn]] void Fail(UINT8 code, const char *format, ...) {
  char message[160];
  va_list arguments;
  va_start(arguments, format);
  FormatToBufferv(message, sizeof(message), format, arguments);
  va_end(arguments);
  SerialPrintf("platform: error: %s\n", message);
  char outcome[192];
  FormatToBuffer(outcome, sizeof(outcome), "Platform error: %s", message);
  End(gEnding.loaderReturned ? gEnding.loaderStatus : EFI_LOAD_ERROR, code, outcome);
}

void *AllocateOrFail(UINTN size, const char *what) {
  void *buffer = nullptr;
  const EFI_STATUS status = gBS->AllocatePool(EfiLoaderData, size, &buffer);
  if (EFI_ERROR(status)) {
    Fail(kExitPlatformFailed, "no memory for %s (%s)", what, StatusName(status));
  }
  return buffer;
}

CHAR16 *WideCopyOrFail(const char *text, const char *what, UINTN *units) {
  Utf8ToUcs2(text, nullptr, 0, units);
  CHAR16 *wide = static_cast<CHAR16 *>(AllocateOrFail((*units + 1) * sizeof(CHAR16), what));
  Utf8ToUcs2(text, wide, *units + 1, units);
  return wide;
}

// Keys and values are echoed bounded, control bytes and all others beyond
// ASCII as \xNN, so that a broken file cannot flood or garble the log.
void ReportConfigIssue(const ConfigIssue &issue, void *) {
  char key[kConfigEchoCapacity];
  char value[kConfigEchoCapacity];
  ConfigEcho(issue.key, key, sizeof(key));
  ConfigEcho(issue.value != nullptr ? issue.value : "", value, sizeof(value));
  const UINT64 line = issue.line;
  switch (issue.problem) {
    case kConfigUnknownKey:
      SerialPrintf("platform: %s line %u: unknown key '%s' ignored\n", kConfigName, line, key);
      break;
    case kConfigNoEquals:
      SerialPrintf("platform: %s line %u: no '=' in '%s'\n", kConfigName, line, key);
      break;
    case kConfigBadValue:
      SerialPrintf("platform: %s line %u: bad value '%s' for '%s'\n", kConfigName, line, value, key);
      break;
  }
}

// `size` bytes of the configuration file, with room for one more behind.
void ParseConfig(char *text, UINTN size, PlatformConfig *config) {
  if (ConfigParse(text, size, config, ReportConfigIssue, nullptr) != 0) {
    Fail(kExitConfigInvalid, "%s has errors", kConfigName);
  }
  SetEnding(*config);
}

// The whole of a file of the platform's volume, with room for a NUL behind
// it; null when the file is not there. Other failures end the run with
// `code`.
char *ReadWholeFile(EFI_FILE_PROTOCOL *root, const CHAR16 *path, const char *name, UINT8 code, UINTN *size) {
  EFI_FILE_PROTOCOL *file = nullptr;
  EFI_STATUS status = root->Open(root, &file, path, EFI_FILE_MODE_READ, 0);
  if (status == EFI_NOT_FOUND) {
    return nullptr;
  }
  if (EFI_ERROR(status)) {
    Fail(code, "cannot open %s (%s)", name, StatusName(status));
  }
  UINT64 infoBuffer[kFileInfoBufferSize / sizeof(UINT64)];
  UINTN infoSize = sizeof(infoBuffer);
  status = file->GetInfo(file, &gEfiFileInfoGuid, &infoSize, infoBuffer);
  if (EFI_ERROR(status)) {
    Fail(code, "cannot size %s (%s)", name, StatusName(status));
  }
  *size = reinterpret_cast<EFI_FILE_INFO *>(infoBuffer)->FileSize;
  char *text = static_cast<char *>(AllocateOrFail(*size + 1, name));
  status = file->Read(file, size, text);
  file->Close(file);
  if (EFI_ERROR(status)) {
    Fail(code, "cannot read %s (%s)", name, StatusName(status));
  }
  return text;
}

// Reads the configuration file into `config`; a volume without one leaves
// the defaults.
void ReadConfig(EFI_FILE_PROTOCOL *root, PlatformConfig *config) {
  ConfigSetDefaults(config);
  UINTN size = 0;
  char *text = ReadWholeFile(root, kConfigPath, kConfigName, kExitConfigInvalid, &size);
  if (text == nullptr) {
    SerialPrintf("platform: no %s, defaults used\n", kConfigName);
    SetEnding(*config);
    return;
  }
  ParseConfig(text, size, config);
}

// The exact times of the volume's files, when the disk tool listed them,
// served to the loader from its device's file system.
void ServeExactTimes(EFI_FILE_PROTOCOL *root, EFI_HANDLE device) {
  UINTN size = 0;
  char *text = ReadWholeFile(root, kTimesPath, kTimesName, kExitConfigInvalid, &size);
  if (text == nullptr) {
    SerialPrintf("platform: no %s, the firmware's own file times\n", kTimesName);
    return;
  }
  FileTimeTable table = {nullptr, 0, FileTimesCapacity(text, size)};
  table.entries =
      static_cast<FileTimeEntry *>(AllocateOrFail(table.capacity * sizeof(FileTimeEntry), kTimesName));
  const UINT32 line = FileTimesParse(text, size, &table);
  if (line != 0) {
    Fail(kExitConfigInvalid, "%s line %u is no time and path", kTimesName, static_cast<UINT64>(line));
  }
  gTimes = table;
  const EFI_STATUS status = FileTimesInstall(device, &gTimes);
  if (EFI_ERROR(status)) {
    Fail(kExitPlatformFailed, "cannot serve exact file times (%s)", StatusName(status));
  }
  gEnding.timedDevice = device;
  SerialPrintf("platform: exact times of %u paths\n", static_cast<UINT64>(gTimes.count));
}

UINTN DevicePathNodeLength(const EFI_DEVICE_PATH_PROTOCOL *node) {
  return static_cast<UINTN>(node->Length[0]) | (static_cast<UINTN>(node->Length[1]) << 8);
}

// The device's own path without its end node, then a file path node and an
// end node.
EFI_DEVICE_PATH_PROTOCOL *FileDevicePath(EFI_HANDLE device, const CHAR16 *path, UINTN pathUnits) {
  void *interface = nullptr;
  EFI_STATUS status = gBS->HandleProtocol(device, &gEfiDevicePathProtocolGuid, &interface);
  if (EFI_ERROR(status) || interface == nullptr) {
    Fail(kExitPlatformFailed, "no device path for the boot device (%s)", StatusName(status));
  }
  const UINT8 *deviceBytes = static_cast<const UINT8 *>(interface);
  UINTN deviceSize = 0;
  for (;;) {
    const EFI_DEVICE_PATH_PROTOCOL *node =
        reinterpret_cast<const EFI_DEVICE_PATH_PROTOCOL *>(deviceBytes + deviceSize);
    const UINTN length = DevicePathNodeLength(node);
    if (node->Type == END_DEVICE_PATH_TYPE || length < sizeof(EFI_DEVICE_PATH_PROTOCOL)) {
      break;
    }
    deviceSize += length;
  }
  const UINTN fileNodeSize = sizeof(EFI_DEVICE_PATH_PROTOCOL) + (pathUnits + 1) * sizeof(CHAR16);
  const UINTN totalSize = deviceSize + fileNodeSize + sizeof(EFI_DEVICE_PATH_PROTOCOL);
  UINT8 *bytes = static_cast<UINT8 *>(AllocateOrFail(totalSize, "the loader's device path"));
  gBS->CopyMem(bytes, deviceBytes, deviceSize);
  const EFI_DEVICE_PATH_PROTOCOL fileHeader = {
      MEDIA_DEVICE_PATH,
      MEDIA_FILEPATH_DP,
      {static_cast<UINT8>(fileNodeSize), static_cast<UINT8>(fileNodeSize >> 8)}};
  gBS->CopyMem(bytes + deviceSize, &fileHeader, sizeof(fileHeader));
  gBS->CopyMem(bytes + deviceSize + sizeof(fileHeader), path, (pathUnits + 1) * sizeof(CHAR16));
  const EFI_DEVICE_PATH_PROTOCOL end = {END_DEVICE_PATH_TYPE, END_ENTIRE_DEVICE_PATH_SUBTYPE, {4, 0}};
  gBS->CopyMem(bytes + deviceSize + fileNodeSize, &end, sizeof(end));
  return reinterpret_cast<EFI_DEVICE_PATH_PROTOCOL *>(bytes);
}

UINT64 FreePagesOrFail(const char *when) {
  UINT64 pages = 0;
  const EFI_STATUS status = MemoryMeterFreePages(&gMeter, &pages);
  if (EFI_ERROR(status)) {
    Fail(kExitPlatformFailed, "cannot read the memory map %s (%s)", when, StatusName(status));
  }
  return pages;
}

// The root of the volume that the platform layer was started from; null when
// its device has no file system.
EFI_FILE_PROTOCOL *OpenOwnVolume(EFI_HANDLE *device) {
  void *interface = nullptr;
  EFI_STATUS status = gBS->HandleProtocol(gImageHandle, &gEfiLoadedImageProtocolGuid, &interface);
  if (EFI_ERROR(status)) {
    Fail(kExitPlatformFailed, "no loaded image (%s)", StatusName(status));
  }
  *device = static_cast<EFI_LOADED_IMAGE_PROTOCOL *>(interface)->DeviceHandle;
  status = gBS->HandleProtocol(*device, &gEfiSimpleFileSystemProtocolGuid, &interface);
  if (EFI_ERROR(status)) {
    return nullptr;  // a network boot
  }
  EFI_SIMPLE_FILE_SYSTEM_PROTOCOL *volume = static_cast<EFI_SIMPLE_FILE_SYSTEM_PROTOCOL *>(interface);
  EFI_FILE_PROTOCOL *root = nullptr;
  status = volume->OpenVolume(volume, &root);
  if (EFI_ERROR(status)) {
    Fail(kExitPlatformFailed, "cannot open the boot volume (%s)", StatusName(status));
  }
  return root;
}

// Reads the configured file whole through the firmware's own file system,
// timed: the firmware's time for what the loader reads of it in the same
// run. Nothing of it stays allocated.
void TimeFirmwareRead(EFI_FILE_PROTOCOL *root, const char *path) {
  UINTN units = 0;
  CHAR16 *wide = WideCopyOrFail(path, "the timed file's path", &units);
  EFI_FILE_PROTOCOL *file = nullptr;
  EFI_STATUS status = root->Open(root, &file, wide, EFI_FILE_MODE_READ, 0);
  gBS->FreePool(wide);
  if (EFI_ERROR(status)) {
    Fail(kExitPlatformFailed, "cannot open %s to time its read (%s)", path, StatusName(status));
  }
  UINT64 infoBuffer[kFileInfoBufferSize / sizeof(UINT64)];
  UINTN size = sizeof(infoBuffer);
  status = file->GetInfo(file, &gEfiFileInfoGuid, &size, infoBuffer);
  const UINT64 fileSize = reinterpret_cast<EFI_FILE_INFO *>(infoBuffer)->FileSize;
  const UINTN pages = (fileSize + 0xFFF) >> 12;
  EFI_PHYSICAL_ADDRESS buffer = 0;
  if (!EFI_ERROR(status)) {
    status = gBS->AllocatePages(AllocateAnyPages, EfiLoaderData, pages, &buffer);
  }
  if (EFI_ERROR(status)) {
    Fail(kExitPlatformFailed, "cannot ready the timed read of %s (%s)", path, StatusName(status));
  }
  size = fileSize;
  const UINT64 start = ReadTsc();
  status = file->Read(file, &size, reinterpret_cast<VOID *>(buffer));
  const UINT64 end = ReadTsc();
  file->Close(file);
  gBS->FreePages(buffer, pages);
  if (EFI_ERROR(status) || size != fileSize) {
    Fail(kExitPlatformFailed, "the timed read of %s failed (%s)", path, StatusName(status));
  }
  SerialPrintf("platform: timed read of %s, %u bytes", path, fileSize);
  ReportTsc("read-start", start);
  ReportTsc("read-end", end);
}

// The loader's hidden text behind the moment it came.
void TimedWriteText(const CHAR16 *text) {
  ReportTsc("text", ReadTsc());
  SerialWriteText(text);
}

void SerialHex(const UINT8 *bytes, UINTN size) {
  static const char kHexDigits[] = "0123456789abcdef";
  for (UINTN i = 0; i < size; i++) {
    SerialPrintf("%c%c", kHexDigits[bytes[i] >> 4], kHexDigits[bytes[i] & 15]);
  }
}

// The device path of the loader's device, end node included, in hex: the
// loader finds its kernel cache by a checksum over these bytes.
void ReportBootDevicePath(EFI_HANDLE device) {
  void *interface = nullptr;
  if (EFI_ERROR(gBS->HandleProtocol(device, &gEfiDevicePathProtocolGuid, &interface)) ||
      interface == nullptr) {
    SerialPrintf("platform: boot device path none\n");
    return;
  }
  const UINT8 *bytes = static_cast<const UINT8 *>(interface);
  SerialPrintf("platform: boot device path ");
  for (UINTN at = 0;;) {
    const EFI_DEVICE_PATH_PROTOCOL *node = reinterpret_cast<const EFI_DEVICE_PATH_PROTOCOL *>(bytes + at);
    const UINTN length = DevicePathNodeLength(node);
    SerialHex(bytes + at, length);
    at += length;
    if (node->Type == END_DEVICE_PATH_TYPE || length < sizeof(EFI_DEVICE_PATH_PROTOCOL)) {
      break;
    }
  }
  SerialPrintf("\n");
}

// What StartImage needs of the loader, made ready before any measurement.
struct LoaderLaunch {
  EFI_DEVICE_PATH_PROTOCOL *devicePath;
  CHAR16 *options;  // null: the loader gets none
  UINT32 optionsSize;
  // A loader fetched over the network: its bytes, and the handle that it is
  // to see as its device. Null when it comes from the volume.
  void *source;
  UINTN sourceSize;
  EFI_HANDLE device;
};

void SetLoadOptions(LoaderLaunch *launch, const PlatformConfig &config) {
  if (config.options != nullptr) {
    UINTN units = 0;
    launch->options = WideCopyOrFail(config.options, "the load options", &units);
    launch->optionsSize = static_cast<UINT32>((units + 1) * sizeof(CHAR16));
  }
}

LoaderLaunch PrepareLoader(EFI_FILE_PROTOCOL *root, EFI_HANDLE device, const PlatformConfig &config) {
  UINTN pathUnits = 0;
  const CHAR16 *path = WideCopyOrFail(config.loaderPath, "the loader's path", &pathUnits);
  EFI_FILE_PROTOCOL *file = nullptr;
  const EFI_STATUS status = root->Open(root, &file, path, EFI_FILE_MODE_READ, 0);
  if (EFI_ERROR(status)) {
    Fail(kExitLoaderMissing, "loader %s not found (%s)", config.loaderPath, StatusName(status));
  }
  file->Close(file);
  LoaderLaunch launch = {FileDevicePath(device, path, pathUnits), nullptr, 0, nullptr, 0, nullptr};
  SetLoadOptions(&launch, config);
  return launch;
}

// "text" or "graphics"; null for a value beyond the modes.
const char *ModeName(EFI_CONSOLE_CONTROL_SCREEN_MODE mode) {
  switch (mode) {
    case EfiConsoleControlScreenText:
      return "text";
    case EfiConsoleControlScreenGraphics:
      return "graphics";
    case kConsoleNone:
      return "none";
    default:
      return nullptr;
  }
}

// Every mode change that the loader asks for shows in the log, on a line of
// its own between the loader's messages.
void ReportSetMode(EFI_CONSOLE_CONTROL_SCREEN_MODE mode, EFI_STATUS status) {
  SerialPrintf("\nplatform: console mode ");
  if (ModeName(mode) != nullptr) {
    SerialPrintf("%s", ModeName(mode));
  } else {
    SerialPrintf("%u", static_cast<UINT64>(mode));
  }
  if (EFI_ERROR(status)) {
    SerialPrintf(" refused (%s)", StatusName(status));
  }
  SerialPrintf("\n");
}

// A protocol that the firmware has of its own, and what became of it.
void ReportFirmwareProtocol(const char *name, bool replaced) {
  SerialPrintf("platform: the firmware has its own %s: %s\n", name, replaced ? "replaced" : "kept");
}

// Every call of the device properties and network boot protocols shows in
// the log, on a line of its own between the loader's messages: the room the
// caller gave, the answer and the size given back.
void ReportAnswerCall(const char *what, UINT64 room, EFI_STATUS status, UINT64 size) {
  SerialPrintf("\nplatform: %s asked with %u bytes: %s, %u bytes\n", what, room, StatusName(status), size);
}

void ReportGetProperties(UINT32 room, EFI_STATUS status, UINT32 size) {
  ReportAnswerCall("device properties", room, status, size);
}

void ReportGetResponse(const char *answer, UINTN room, EFI_STATUS status, UINTN size) {
  char what[32];
  FormatToBuffer(what, sizeof(what), "net boot %s", answer);
  ReportAnswerCall(what, room, status, size);
}

// "none" for an answer or blob that the configuration doesn't give, else
// its size.
void ReportBytes(const char *what, const ConfigBytes &bytes) {
  if (bytes.bytes == nullptr) {
    SerialPrintf("%s none", what);
  } else {
    SerialPrintf("%s %u bytes", what, static_cast<UINT64>(bytes.size));
  }
}

// The device properties and network boot protocols, each only when the
// configuration gives what it answers with.
void InstallAnswerProtocols(const PlatformConfig &config) {
  ReportBytes("platform: device properties:", config.deviceProperties);
  if (gNetBoot.pxe == nullptr) {
    ReportBytes("\nplatform: net boot: dhcp", config.dhcpResponse);
    ReportBytes(", bsdp", config.bsdpResponse);
  }
  SerialPrintf("\n");
  ProtocolSlot slot;
  if (config.deviceProperties.bytes != nullptr &&
      ProtocolClaim(gNimbDevicePropertiesProtocolGuid, "device properties", config.replaceFirmwareProtocols,
                    &slot)) {
    const EFI_STATUS status = DevicePropertiesInstall(&gDeviceProperties, config.deviceProperties, slot);
    if (EFI_ERROR(status)) {
      Fail(kExitPlatformFailed, "cannot install the device properties (%s)", StatusName(status));
    }
    gDeviceProperties.onGetProperties = ReportGetProperties;
  }
  if (gNetBoot.pxe == nullptr &&
      (config.dhcpResponse.bytes != nullptr || config.bsdpResponse.bytes != nullptr) &&
      ProtocolClaim(gNimbNetBootInfoProtocolGuid, "network boot information", config.replaceFirmwareProtocols,
                    &slot)) {
    const EFI_STATUS status =
        NetBootInfoInstall(&gNetBootInfo, config.dhcpResponse, config.bsdpResponse, slot);
    if (EFI_ERROR(status)) {
      Fail(kExitPlatformFailed, "cannot install the network boot information (%s)", StatusName(status));
    }
    gNetBootInfo.onGetResponse = ReportGetResponse;
  }
}

// The protocols of the machines that the loader was made for, which the
// firmware lacks.
void InstallProtocols(const PlatformConfig &config) {
  EFI_STATUS status = EFI_SUCCESS;
  ProtocolSlot slot;
  if (config.consoleMode != kConsoleNone && ProtocolClaim(gEfiConsoleControlProtocolGuid, "console control",
                                                          config.replaceFirmwareProtocols, &slot)) {
    status = ConsoleControlInstall(&gConsole, config.consoleMode, slot);
    if (EFI_ERROR(status)) {
      Fail(kExitPlatformFailed, "cannot install console control (%s)", StatusName(status));
    }
    gConsole.onSetMode = ReportSetMode;
    gConsole.hiddenText = config.timeText ? TimedWriteText : SerialWriteText;
    if (gConsole.mode != config.consoleMode) {
      SerialPrintf("platform: no graphics output: console %s\n", ModeName(gConsole.mode));
    }
  }
  // Drawing for the loader's boot screen; a firmware without graphics output
  // boots without pictures.
  status = InstallGraphicsProtocols(gST, config.replaceFirmwareProtocols);
  if (EFI_ERROR(status)) {
    SerialPrintf("platform: no graphics for the boot screen (%s)\n", StatusName(status));
  }
  KeySample sample;
  status = KeyProtocolsInstall(&gKeyState, &gBootPolicy, config, &sample);
  if (EFI_ERROR(status)) {
    Fail(kExitPlatformFailed, "cannot install the key protocols (%s)", StatusName(status));
  }
  if (sample.status != EFI_NOT_STARTED) {
    SerialPrintf("platform: keyboard: %s, partial keys %s, %u keystrokes\n", StatusName(sample.status),
                 StatusName(sample.exposeState), static_cast<UINT64>(sample.strokes));
  }
  if (gKeyState.protocol.ReadKeyState != nullptr) {  // not when the firmware's own is kept
    SerialPrintf("platform: keys: modifiers 0x%x, %u keys, ignored %u, from %s\n",
                 static_cast<UINT64>(gKeyState.held.modifiers), static_cast<UINT64>(gKeyState.held.count),
                 static_cast<UINT64>(config.keysIgnored ? 1 : 0),
                 config.keysGiven ? "platform.cfg" : "keyboard");
  }
  if (ProtocolClaim(gEfiDataHubProtocolGuid, "Data Hub", config.replaceFirmwareProtocols, &slot)) {
    status = DataHubInstall(&gDataHub, config.dataHub, slot);
    if (EFI_ERROR(status)) {
      Fail(kExitPlatformFailed, "cannot install the Data Hub (%s)", StatusName(status));
    }
    SerialPrintf("platform: data hub: %u platform records\n", static_cast<UINT64>(config.dataHub.count));
  }
  InstallAnswerProtocols(config);
}

// The loader's variables that the configuration names; the others stay as
// they are. Changes that stay (set for good, deleted) are made on the first
// start of a run only; a variable for this boot only is set at every start,
// as a reset has taken it. The values are wiped behind them: the variable
// store keeps the only copy (a key among them is looked for in memory after
// a resume).
void SetVariables(const ConfigEntryList &variables, bool firstStart) {
  constexpr UINT32 kThisBoot = EFI_VARIABLE_BOOTSERVICE_ACCESS | EFI_VARIABLE_RUNTIME_ACCESS;
  for (UINT32 i = 0; i < variables.count; i++) {
    const ConfigEntry &variable = variables.entries[i];
    UINTN units = 0;
    CHAR16 *name = WideCopyOrFail(variable.name, "a variable's name", &units);
    UINTN found = 0;
    if (gRT->GetVariable(name, &gNimbVendorVariableGuid, nullptr, &found, nullptr) == EFI_BUFFER_TOO_SMALL) {
      SerialPrintf("platform: nvram %s at start: %u bytes\n", variable.name, static_cast<UINT64>(found));
    } else {
      SerialPrintf("platform: nvram %s at start: absent\n", variable.name);
    }
    if (!firstStart && variable.life != kVariableThisBoot) {
      SerialPrintf("platform: nvram %s left as the first start made it\n", variable.name);
      gBS->FreePool(name);
      continue;
    }
    const UINT32 attributes = variable.life == kVariableDeleted    ? 0
                              : variable.life == kVariableThisBoot ? kThisBoot
                                                                   : kThisBoot | EFI_VARIABLE_NON_VOLATILE;
    const EFI_STATUS status =
        gRT->SetVariable(name, &gNimbVendorVariableGuid, attributes, variable.size, variable.bytes);
    gBS->FreePool(name);
    if (variable.life == kVariableDeleted) {
      if (EFI_ERROR(status) && status != EFI_NOT_FOUND) {
        Fail(kExitPlatformFailed, "cannot delete NVRAM variable %s (%s)", variable.name, StatusName(status));
      }
      SerialPrintf("platform: nvram %s %s\n", variable.name,
                   status == EFI_NOT_FOUND ? "not there to delete" : "deleted");
      continue;
    }
    const char *life = variable.life == kVariableThisBoot ? "for this boot" : "for good";
    if (EFI_ERROR(status)) {
      Fail(kExitPlatformFailed, "cannot set NVRAM variable %s %s (%s)", variable.name, life,
           StatusName(status));
    }
    SerialPrintf("platform: nvram %s set %s, %u bytes\n", variable.name, life,
                 static_cast<UINT64>(variable.size));
  }
  if (firstStart) {
    ReportKeyCopies(variables);
  }
  for (UINT32 i = 0; i < variables.count; i++) {
    volatile UINT8 *bytes = const_cast<UINT8 *>(variables.entries[i].bytes);
    for (UINT32 j = 0; j < variables.entries[i].size; j++) {
      bytes[j] = 0;
    }
  }
}

// A read's moments go to the log as TSC values, taken on either side of the
// transfer alone.
void ReportReadStart(const char *name, UINT64 room) {
  SerialPrintf("\nplatform: net read of %s into %u bytes starts\n", name, room);
  ReportTsc("net-read-start", ReadTsc());
}

// The firmware's own PXE download of the boot file again, timed, to set the
// network file loader's transfers against.
void TimePxeDownload(EFI_HANDLE device) {
  void *interface = nullptr;
  EFI_STATUS status = gBS->HandleProtocol(device, &gEfiLoadFileProtocolGuid, &interface);
  if (EFI_ERROR(status)) {
    Fail(kExitPlatformFailed, "no firmware LoadFile to time (%s)", StatusName(status));
  }
  EFI_LOAD_FILE_PROTOCOL *firmware = static_cast<EFI_LOAD_FILE_PROTOCOL *>(interface);
  EFI_DEVICE_PATH_PROTOCOL end = {END_DEVICE_PATH_TYPE, END_ENTIRE_DEVICE_PATH_SUBTYPE, {4, 0}};
  UINTN size = 0;
  status = firmware->LoadFile(firmware, &end, TRUE, &size, nullptr);
  if (status != EFI_BUFFER_TOO_SMALL) {
    Fail(kExitPlatformFailed, "the firmware's PXE gave no boot file size (%s)", StatusName(status));
  }
  EFI_PHYSICAL_ADDRESS buffer = 0;
  status = gBS->AllocatePages(AllocateAnyPages, EfiLoaderData, EFI_SIZE_TO_PAGES(size), &buffer);
  if (EFI_ERROR(status)) {
    Fail(kExitPlatformFailed, "no memory for the boot file (%s)", StatusName(status));
  }
  const UINT64 start = ReadTsc();
  status = firmware->LoadFile(firmware, &end, TRUE, &size, reinterpret_cast<void *>(buffer));
  const UINT64 stop = ReadTsc();
  SerialPrintf("platform: net firmware download of the boot file: %s, %u bytes\n", StatusName(status), size);
  ReportTsc("pxe-download-start", start);
  ReportTsc("pxe-download-end", stop);
  // The same file through the network's own LoadFile, here in the platform,
  // where no loader and no spinner run: what the loader's fetch costs beyond
  // the transfer itself shows against it.
  const char *name = reinterpret_cast<const char *>(gNetBoot.pxe->Mode->DhcpAck.Dhcpv4.BootpBootFile);
  UINTN units = 0;
  const CHAR16 *wide = WideCopyOrFail(name, "the boot file's name", &units);
  EFI_DEVICE_PATH_PROTOCOL *path = FileDevicePath(gNetBoot.handle, wide, units);
  UINTN room = size;
  status = gNetBoot.loadFile.protocol.LoadFile(&gNetBoot.loadFile.protocol, path, FALSE, &room,
                                               reinterpret_cast<void *>(buffer));
  if (EFI_ERROR(status)) {
    Fail(kExitPlatformFailed, "the network's LoadFile didn't fetch the boot file (%s)", StatusName(status));
  }
  gBS->FreePages(buffer, EFI_SIZE_TO_PAGES(size));
}

// The firmware picks the loader's device by its path, and the NIC's own
// handle has the same path as the network handle: the loader is to see the
// network handle, which alone serves its files.
void SetLoaderDevice(EFI_LOADED_IMAGE_PROTOCOL *image, EFI_HANDLE device) {
  if (image->DeviceHandle != device) {
    SerialPrintf("platform: net: the loader's device set to the network handle\n");
    image->DeviceHandle = device;
  }
}

EFI_STATUS RunLoader(const LoaderLaunch &launch, const PlatformConfig &config) {
  EFI_HANDLE loader = nullptr;
  EFI_STATUS status =
      gBS->LoadImage(FALSE, gImageHandle, launch.devicePath, launch.source, launch.sourceSize, &loader);
  if (EFI_ERROR(status)) {
    Fail(kExitLoadImageFailed, "cannot load %s (%s)", config.loaderPath, StatusName(status));
  }
  void *interface = nullptr;
  status = gBS->HandleProtocol(loader, &gEfiLoadedImageProtocolGuid, &interface);
  if (EFI_ERROR(status)) {
    Fail(kExitLoadImageFailed, "no loaded image for %s (%s)", config.loaderPath, StatusName(status));
  }
  EFI_LOADED_IMAGE_PROTOCOL *image = static_cast<EFI_LOADED_IMAGE_PROTOCOL *>(interface);
  if (launch.device != nullptr) {
    SetLoaderDevice(image, launch.device);
  }
  if (launch.options != nullptr) {
    image->LoadOptions = launch.options;
    image->LoadOptionsSize = launch.optionsSize;
  }
  // While the loader runs, its text stays off a graphics screen.
  ConsoleOfferScreenText(&gConsole, true);
  ReportTsc("start-image", ReadTsc());
  status = gBS->StartImage(loader, nullptr, nullptr);
  ConsoleOfferScreenText(&gConsole, false);
  return status;
}

// --- a network boot -----------------------------------------------------------

// One byte more than asked, for the configuration parser.
void *AllocateForFetch(UINTN size) {
  void *buffer = nullptr;
  return EFI_ERROR(gBS->AllocatePool(EfiLoaderData, size + 1, &buffer)) ? nullptr : buffer;
}

// Every TFTP transfer shows in the log, on a line of its own.
void ReportTransfer(const char *name, const char *what, UINT64 room, EFI_STATUS status, UINT64 size) {
  const UINT64 end = ReadTsc();
  if (room == 0) {
    SerialPrintf("\nplatform: net %s of %s: %s, %u bytes\n", what, name, StatusName(status), size);
  } else {
    SerialPrintf("\nplatform: net %s of %s into %u bytes: %s, %u bytes\n", what, name, room,
                 StatusName(status), size);
  }
  if (room != 0) {
    ReportTsc("net-read-end", end);
  }
}

// Started by the firmware's PXE: installs the file loader, reads the
// configuration and the loader from the TFTP server and gives the network
// boot information protocol the server's real answers.
LoaderLaunch PrepareNetworkBoot(EFI_HANDLE device, PlatformConfig *config) {
  EFI_STATUS status = NetBootStart(device, &gNetBoot);
  if (EFI_ERROR(status)) {
    Fail(kExitPlatformFailed, "no file system and no network on the boot device (%s)", StatusName(status));
  }
  gNetBoot.loadFile.onTransfer = ReportTransfer;
  gNetBoot.loadFile.onReadStart = ReportReadStart;
  const EFI_PXE_BASE_CODE_MODE *mode = gNetBoot.pxe->Mode;
  const UINT8 *server = gNetBoot.loadFile.server.v4;
  SerialPrintf("platform: net boot: station %u.%u.%u.%u, server %u.%u.%u.%u\n",
               static_cast<UINT64>(mode->StationIp.v4[0]), static_cast<UINT64>(mode->StationIp.v4[1]),
               static_cast<UINT64>(mode->StationIp.v4[2]), static_cast<UINT64>(mode->StationIp.v4[3]),
               static_cast<UINT64>(server[0]), static_cast<UINT64>(server[1]), static_cast<UINT64>(server[2]),
               static_cast<UINT64>(server[3]));

  ConfigSetDefaults(config);
  config->loaderPath = kDefaultNetLoaderName;
  void *bytes = nullptr;
  UINT64 size = 0;
  status = NetLoadFileFetch(&gNetBoot.loadFile, kConfigName, AllocateForFetch, &bytes, &size);
  if (status == EFI_NOT_FOUND) {
    SerialPrintf("platform: no %s, defaults used\n", kConfigName);
    SetEnding(*config);
  } else if (EFI_ERROR(status)) {
    Fail(kExitConfigInvalid, "cannot fetch %s (%s)", kConfigName, StatusName(status));
  } else {
    ParseConfig(static_cast<char *>(bytes), size, config);
  }
  if (config->timePxeDownload) {
    TimePxeDownload(device);
  }
  status = NetLoadFileFetch(&gNetBoot.loadFile, config->loaderPath, AllocateForFetch, &bytes, &size);
  if (EFI_ERROR(status)) {
    Fail(status == EFI_NOT_FOUND ? kExitLoaderMissing : kExitLoadImageFailed, "loader %s not fetched (%s)",
         config->loaderPath, StatusName(status));
  }
  UINTN units = 0;
  const CHAR16 *path = WideCopyOrFail(config->loaderPath, "the loader's path", &units);
  LoaderLaunch launch = {
      FileDevicePath(gNetBoot.handle, path, units), nullptr, 0, bytes, size, gNetBoot.handle};
  SetLoadOptions(&launch, *config);

  // The server's answers as the base code kept them.
  const ConfigBytes dhcp = {mode->DhcpAck.Raw, static_cast<UINT32>(DhcpMessageLength(
                                                   mode->DhcpAck.Raw, sizeof(mode->DhcpAck.Raw)))};
  ConfigBytes discovery = {nullptr, 0};
  if (mode->PxeReplyReceived) {
    discovery = {mode->PxeReply.Raw,
                 static_cast<UINT32>(DhcpMessageLength(mode->PxeReply.Raw, sizeof(mode->PxeReply.Raw)))};
  }
  ReportBytes("platform: net boot answers: dhcp", dhcp);
  ReportBytes(", bsdp", discovery);
  // The answer's bytes, which the kernel is to find as they are.
  SerialPrintf("\nplatform: net boot dhcp answer ");
  SerialHex(dhcp.bytes, dhcp.size);
  SerialPrintf("\n");
  ProtocolSlot slot;
  if (!ProtocolClaim(gNimbNetBootInfoProtocolGuid, "network boot information",
                     config->replaceFirmwareProtocols, &slot)) {
    return launch;
  }
  status = NetBootInfoInstall(&gNetBootInfo, dhcp, discovery, slot);
  if (EFI_ERROR(status)) {
    Fail(kExitPlatformFailed, "cannot install the network boot information (%s)", StatusName(status));
  }
  gNetBootInfo.onGetResponse = ReportGetResponse;
  return launch;
}

}  // namespace

extern "C" EFI_STATUS EFIAPI PlatformEntry(EFI_HANDLE ImageHandle, EFI_SYSTEM_TABLE *SystemTable) {
  gImageHandle = ImageHandle;
  gST = SystemTable;
  gBS = SystemTable->BootServices;
  gRT = SystemTable->RuntimeServices;
  // The boot manager's watchdog would reset a slow run.
  gBS->SetWatchdogTimer(0, 0, 0, nullptr);
  gOnFirmwareProtocol = ReportFirmwareProtocol;
  SerialPrintf("\nplatform: started\n");
  // Until a configuration says otherwise.
  gEnding.debugExit = MachineIsQemu();

  // Everything that allocates comes before the first measurement.
  EFI_HANDLE device = nullptr;
  EFI_FILE_PROTOCOL *root = OpenOwnVolume(&device);
  PlatformConfig config;
  LoaderLaunch launch;
  UINTN directories = 0;
  if (root != nullptr) {
    ReadConfig(root, &config);
    launch = PrepareLoader(root, device, config);
    ReportBootDevicePath(device);
    if (config.timedReadPath != nullptr) {
      TimeFirmwareRead(root, config.timedReadPath);
    }
    ServeExactTimes(root, device);
    // The firmware's FAT keeps a few directories cached after they are
    // closed (the last ones used); the same walk before both measurements
    // leaves the same ones cached, so that only what the loader kept shows.
    // The root stays open for the second walk.
    directories = MemoryWarmDirectoryCache(root);
  } else {
    launch = PrepareNetworkBoot(device, &config);
  }
  InstallProtocols(config);
  // A machine that resets starts again on the same variable store: what
  // stays of the configured variables is done on the first start only.
  const UINT32 boot = CountBoot();
  ReportResumeVariables();
  SetVariables(config.nvram, boot == 1);
  if (config.timedExtents.bytes != nullptr) {
    TimedRead(config.timedExtents);
  }
  // The benchmark that times the firmware's read also times the loader's.
  WatchDiskAndReset(config.timedExtents.bytes != nullptr);
  MemoryStockPool();
  const EFI_STATUS status = MemoryMeterInit(&gMeter);
  if (EFI_ERROR(status)) {
    Fail(kExitPlatformFailed, "cannot size the memory map (%s)", StatusName(status));
  }
  SerialPrintf("platform: starting %s, console %s, %u directories\n", config.loaderPath,
               ModeName(config.consoleMode == kConsoleNone ? kConsoleNone : gConsole.mode), directories);

  const UINT64 pagesBefore = FreePagesOrFail("before the loader");
  const EFI_STATUS loaderStatus = RunLoader(launch, config);
  // The status first: whatever fails after it, the log has it.
  SerialPrintf("\nplatform: loader returned 0x%x (%s)\n", loaderStatus, StatusName(loaderStatus));
  gEnding.loaderReturned = true;
  gEnding.loaderStatus = loaderStatus;
  if (root != nullptr) {
    MemoryWarmDirectoryCache(root);
  }
  const UINT64 pagesAfter = FreePagesOrFail("after the loader");
  if (gTimes.entries != nullptr) {
    SerialPrintf("platform: exact times served %u times\n", FileTimesServed());
  }
  const bool changed = pagesAfter != pagesBefore;
  if (changed) {
    SerialPrintf("platform: memory changed (before %u pages, after %u pages)\n", pagesBefore, pagesAfter);
  } else {
    SerialPrintf("platform: memory same\n");
  }
  for (UINT32 second = 0; second < config.holdSeconds; second++) {
    gBS->Stall(1000000);
  }
  char outcome[96];
  FormatToBuffer(outcome, sizeof(outcome), "The loader returned %s (0x%x).", StatusName(loaderStatus),
                 loaderStatus);
  End(loaderStatus, ExitCodeForOutcome(loaderStatus, changed), outcome);
}

}  // namespace nimb::platform
