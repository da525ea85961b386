// dryboot: runs the boot loader on the host firmware against a directory that
// stands for the boot volume, and prints what the loader said and what the
// kernel would receive.
#include <sys/stat.h>

#include <cstdio>
#include <cstring>
#include <optional>
#include <string>
#include <vector>

#include "boot/boot.h"
#include "config/boot_options.h"
#include "efi/datahub.h"
#include "efi/vendor.h"
#include "hostfw/hostfw.h"
#include "kernel_image.h"
#include "kernel_view.h"

namespace {

constexpr int kExitKernelEntered = 0;
constexpr int kExitNoKernel = 1;
constexpr int kExitUsage = 2;
constexpr int kExitChecksFailed = 3;

constexpr UINT32 kScreenWidth = 1280;
constexpr UINT32 kScreenHeight = 800;

const char kUsage[] =
    "Usage: dryboot [options] VOLUME_DIR\n"
    "Runs the boot loader on the host firmware, booting from the directory\n"
    "VOLUME_DIR, and prints the loader's console output, how the run ended\n"
    "and, when the kernel was entered, what it was handed.\n"
    "\n"
    "Options:\n"
    "  --options TEXT      the load options the firmware hands over\n"
    "  --nvram NAME=VALUE  a variable of the loader's vendor GUID (repeatable);\n"
    "                      VALUE is stored as its bytes, %XX standing for the\n"
    "                      byte of hexadecimal XX\n"
    "  --keys KEYS         keys held at start: shift, gui+v or gui+s\n"
    "  --text              the console starts in text mode (default: graphics,\n"
    "                      on a 1280x800 screen)\n"
    "  --model TEXT        a \"Model\" record in the firmware's Data Hub\n"
    "  --help              this text\n"
    "\n"
    "Exit status: 0 when the kernel was entered and every check of what it\n"
    "was handed passed, 1 when it was not entered (with the status and the\n"
    "step at which the kernel file was refused), 2 for a wrong command line,\n"
    "3 when it was entered but a check failed.\n";

struct HeldKeys {
  const char *name;
  UINT16 modifiers;
  UINT16 key;  // 0 for none
};

const HeldKeys kHeldKeys[] = {
    {"shift", kKeyModifierLeftShift, 0},
    {"gui+v", kKeyModifierLeftGui, kKeyV},
    {"gui+s", kKeyModifierLeftGui, kKeyS},
};

struct Settings {
  bool help = false;
  std::string volume;
  std::optional<std::string> loadOptions;
  std::vector<std::pair<std::string, std::vector<uint8_t>>> variables;
  const HeldKeys *keys = nullptr;
  bool text = false;
  std::optional<std::string> model;
};

// --- the command line ----------------------------------------------------------------

std::u16string Utf16(const std::string &text) {
  std::u16string out;
  for (size_t i = 0; i < text.size();) {
    const uint8_t lead = static_cast<uint8_t>(text[i]);
    const size_t length = lead < 0x80             ? 1
                          : (lead & 0xE0) == 0xC0 ? 2
                          : (lead & 0xF0) == 0xE0 ? 3
                          : (lead & 0xF8) == 0xF0 ? 4
                                                  : 0;
    uint32_t c = length == 1 ? lead : length == 0 ? 0 : lead & (0x7F >> length);
    bool valid = length != 0 && i + length <= text.size();
    for (size_t k = 1; valid && k < length; k++) {
      const uint8_t next = static_cast<uint8_t>(text[i + k]);
      valid = (next & 0xC0) == 0x80;
      c = c << 6 | (next & 0x3F);
    }
    if (!valid) {
      out.push_back(u'\uFFFD');
      i++;
      continue;
    }
    i += length;
    if (c >= 0x10000) {
      c -= 0x10000;
      out.push_back(static_cast<char16_t>(0xD800 + (c >> 10)));
      out.push_back(static_cast<char16_t>(0xDC00 + (c & 0x3FF)));
    } else {
      out.push_back(static_cast<char16_t>(c));
    }
  }
  return out;
}

int HexDigit(char c) {
  return c >= '0' && c <= '9'   ? c - '0'
         : c >= 'a' && c <= 'f' ? c - 'a' + 10
         : c >= 'A' && c <= 'F' ? c - 'A' + 10
                                : -1;
}

// The text's bytes, "%XX" read as one byte.
std::vector<uint8_t> VariableBytes(const std::string &text) {
  std::vector<uint8_t> bytes;
  for (size_t i = 0; i < text.size(); i++) {
    if (text[i] == '%' && i + 2 < text.size() && HexDigit(text[i + 1]) >= 0 && HexDigit(text[i + 2]) >= 0) {
      bytes.push_back(static_cast<uint8_t>(HexDigit(text[i + 1]) << 4 | HexDigit(text[i + 2])));
      i += 2;
    } else {
      bytes.push_back(static_cast<uint8_t>(text[i]));
    }
  }
  return bytes;
}

// Reads the command line into `settings`; what is wrong with it, or an empty
// text.
std::string Parse(int argc, char **argv, Settings *settings) {
  std::vector<std::string> positional;
  for (int i = 1; i < argc; i++) {
    std::string argument = argv[i];
    std::string value;
    bool hasValue = false;
    const size_t equals = argument.find('=');
    if (argument.compare(0, 2, "--") == 0 && equals != std::string::npos) {
      value = argument.substr(equals + 1);
      argument.erase(equals);
      hasValue = true;
    }
    // The option's value: behind its "=", or the next argument.
    auto take = [&]() -> bool {
      if (hasValue) {
        return true;
      }
      if (i + 1 >= argc) {
        return false;
      }
      value = argv[++i];
      return true;
    };
    if ((argument == "--help" || argument == "--text") && hasValue) {
      return argument + " takes no value";
    } else if (argument == "--help" || argument == "-h") {
      settings->help = true;
      return "";
    } else if (argument == "--text") {
      settings->text = true;
    } else if (argument == "--options") {
      if (!take()) {
        return "--options needs a text";
      }
      settings->loadOptions = value;
    } else if (argument == "--model") {
      if (!take()) {
        return "--model needs a text";
      }
      settings->model = value;
    } else if (argument == "--nvram") {
      const size_t split = take() ? value.find('=') : std::string::npos;
      if (split == std::string::npos || split == 0) {
        return "--nvram needs NAME=VALUE";
      }
      settings->variables.emplace_back(value.substr(0, split), VariableBytes(value.substr(split + 1)));
    } else if (argument == "--keys") {
      if (!take()) {
        return "--keys needs shift, gui+v or gui+s";
      }
      settings->keys = nullptr;
      for (const HeldKeys &keys : kHeldKeys) {
        if (value == keys.name) {
          settings->keys = &keys;
        }
      }
      if (settings->keys == nullptr) {
        return "--keys " + value + ": not shift, gui+v or gui+s";
      }
    } else if (argument.compare(0, 1, "-") == 0 && argument != "-") {
      return "unknown option " + argument;
    } else {
      positional.push_back(argv[i]);
    }
  }
  if (positional.size() != 1) {
    return positional.empty() ? "no volume directory" : "more than one volume directory";
  }
  settings->volume = positional[0];
  struct stat info;
  if (stat(settings->volume.c_str(), &info) != 0 || !S_ISDIR(info.st_mode)) {
    return settings->volume + ": not a directory";
  }
  return "";
}

// --- the machine ---------------------------------------------------------------------

// The keyboard's report of the keys held at start.
struct KeyState {
  NIMB_KEY_STATE_PROTOCOL protocol;
  const HeldKeys *keys;
};

EFI_STATUS EFIAPI ReadKeyState(NIMB_KEY_STATE_PROTOCOL *This, UINT16 *Modifiers, UINTN *KeyCount,
                               UINT16 *Keys) {
  const HeldKeys *held = reinterpret_cast<KeyState *>(This)->keys;
  if (Modifiers == nullptr || KeyCount == nullptr || (*KeyCount != 0 && Keys == nullptr)) {
    return EFI_INVALID_PARAMETER;
  }
  const UINTN count = held->key != 0 ? 1 : 0;
  if (*KeyCount < count) {
    return EFI_BUFFER_TOO_SMALL;
  }
  *Modifiers = held->modifiers;
  *KeyCount = count;
  if (count != 0) {
    Keys[0] = held->key;
  }
  return EFI_SUCCESS;
}

std::vector<uint8_t> Ucs2Bytes(const std::u16string &text) {
  std::vector<uint8_t> bytes;
  for (char16_t unit : text) {
    bytes.push_back(static_cast<uint8_t>(unit));
    bytes.push_back(static_cast<uint8_t>(unit >> 8));
  }
  return bytes;
}

// A machine like those the loader is made for: a screen, ACPI tables, the
// volume as boot device, and what the command line asks for.
void Prepare(hostfw::Firmware &fw, const Settings &settings, KeyState *keyState) {
  hostfw::ScreenOptions screen;
  screen.width = kScreenWidth;
  screen.height = kScreenHeight;
  fw.AddScreen(screen);
  fw.SetConsoleMode(settings.text ? EfiConsoleControlScreenText : EfiConsoleControlScreenGraphics);
  fw.InstallAcpi(hostfw::AcpiOptions());
  fw.SetBootDevice(fw.AddDirectoryVolume(settings.volume));
  if (settings.loadOptions) {
    fw.SetLoadOptions(Utf16(*settings.loadOptions));
  }
  for (const auto &variable : settings.variables) {
    fw.PutVariable(Utf16(variable.first), gNimbVendorVariableGuid,
                   EFI_VARIABLE_NON_VOLATILE | EFI_VARIABLE_BOOTSERVICE_ACCESS | EFI_VARIABLE_RUNTIME_ACCESS,
                   variable.second);
  }
  if (settings.keys != nullptr) {
    keyState->protocol.Reserved = nullptr;
    keyState->protocol.ReadKeyState = ReadKeyState;
    keyState->keys = settings.keys;
    fw.InstallProtocol(fw.NewHandle(), gNimbKeyStateProtocolGuid, keyState);
  }
  if (settings.model) {
    std::vector<uint8_t> value = Ucs2Bytes(Utf16(*settings.model) + u'\0');
    fw.AddDataHubRecord(gNimbPlatformProducerGuid, u"Model", value);
    // The hub hands over its last record together with the end of the walk,
    // and the loader never looks at that one: a record follows the model,
    // as on a machine that logs many.
    fw.AddDataHubRecord(gNimbPlatformProducerGuid, u"SystemSerialNumber", Ucs2Bytes(u"DRYBOOT0"));
  }
}

// --- the report ----------------------------------------------------------------------

std::string StatusText(uint64_t status) {
  static const struct {
    EFI_STATUS status;
    const char *name;
  } kNames[] = {
#define NAMED(status) {status, #status}
      NAMED(EFI_SUCCESS),
      NAMED(EFI_LOAD_ERROR),
      NAMED(EFI_INVALID_PARAMETER),
      NAMED(EFI_UNSUPPORTED),
      NAMED(EFI_BAD_BUFFER_SIZE),
      NAMED(EFI_BUFFER_TOO_SMALL),
      NAMED(EFI_NOT_READY),
      NAMED(EFI_DEVICE_ERROR),
      NAMED(EFI_WRITE_PROTECTED),
      NAMED(EFI_OUT_OF_RESOURCES),
      NAMED(EFI_VOLUME_CORRUPTED),
      NAMED(EFI_VOLUME_FULL),
      NAMED(EFI_NO_MEDIA),
      NAMED(EFI_MEDIA_CHANGED),
      NAMED(EFI_NOT_FOUND),
      NAMED(EFI_ACCESS_DENIED),
      NAMED(EFI_NO_RESPONSE),
      NAMED(EFI_NO_MAPPING),
      NAMED(EFI_TIMEOUT),
      NAMED(EFI_NOT_STARTED),
      NAMED(EFI_ALREADY_STARTED),
      NAMED(EFI_ABORTED),
      NAMED(EFI_PROTOCOL_ERROR),
      NAMED(EFI_INCOMPATIBLE_VERSION),
      NAMED(EFI_SECURITY_VIOLATION),
      NAMED(EFI_CRC_ERROR),
      NAMED(EFI_END_OF_MEDIA),
      NAMED(EFI_END_OF_FILE),
#undef NAMED
  };
  char number[32];
  std::snprintf(number, sizeof(number), "0x%llx", static_cast<unsigned long long>(status));
  for (const auto &entry : kNames) {
    if (entry.status == status) {
      return std::string(entry.name) + " (" + number + ")";
    }
  }
  return number;
}

// The console as a terminal shows it: line ends without their carriage
// returns, and a line end after the last message, which often has none.
void PrintConsole(const std::string &console) {
  std::printf("--- loader console ---\n");
  std::string text;
  for (size_t i = 0; i < console.size(); i++) {
    if (console[i] == '\r' && i + 1 < console.size() && console[i + 1] == '\n') {
      continue;
    }
    text.push_back(console[i]);
  }
  if (!text.empty() && text.back() != '\n') {
    text.push_back('\n');
  }
  std::fputs(text.c_str(), stdout);
  std::printf("--- end of console ---\n");
}

void PrintEnd(const hostfw::RunResult &result) {
  switch (result.end) {
    case hostfw::RunEnd::KernelEntered:
      std::printf("kernel entered at 0x%llx, with BootArgs at 0x%llx\n",
                  static_cast<unsigned long long>(result.gateTarget),
                  static_cast<unsigned long long>(result.gateArgument));
      break;
    case hostfw::RunEnd::Exited:
      std::printf("the firmware got status %s through Exit\n", StatusText(result.status).c_str());
      break;
    case hostfw::RunEnd::Returned:
      std::printf("the firmware got status %s as the loader returned\n", StatusText(result.status).c_str());
      break;
    case hostfw::RunEnd::Reset:
      std::printf("the loader reset the machine (%s reset, status %s)\n",
                  result.resetType == EfiResetCold   ? "cold"
                  : result.resetType == EfiResetWarm ? "warm"
                                                     : "other",
                  StatusText(result.status).c_str());
      break;
    case hostfw::RunEnd::Halted:
      std::printf("the loader halted the machine\n");
      break;
  }
}

}  // namespace

int main(int argc, char **argv) {
  Settings settings;
  const std::string complaint = Parse(argc, argv, &settings);
  if (settings.help) {
    std::fputs(kUsage, stdout);
    return kExitKernelEntered;
  }
  if (!complaint.empty()) {
    std::fprintf(stderr, "dryboot: %s\nUsage: dryboot [options] VOLUME_DIR (--help for the options)\n",
                 complaint.c_str());
    return kExitUsage;
  }

  hostfw::Firmware fw;
  KeyState keyState = {};
  Prepare(fw, settings, &keyState);
  const hostfw::RunResult result = fw.Run(BootEntry);

  PrintConsole(fw.ConOutText());
  PrintEnd(result);
  std::string kernelName;
  for (const CHAR16 *p = nimb::gKernelName; p != nullptr && *p != 0; p++)
    kernelName.push_back(*p < 0x80 ? static_cast<char>(*p) : '?');
  const dryboot::KernelImage image = dryboot::FindKernelImage(settings.volume, kernelName);
  if (result.end != hostfw::RunEnd::KernelEntered) {
    // Why the kernel did not load, when it was the kernel.
    if (fw.ConOutText().find("Error loading kernel") != std::string::npos) {
      std::string why = image.path.empty() ? "no such file in the volume or its boot directories"
                                           : dryboot::KernelLoadFailure(image.bytes, StatusText);
      std::printf("kernel '%s': %s\n", kernelName.c_str(), why.empty() ? "loads here" : why.c_str());
    }
    return kExitNoKernel;
  }
  const std::vector<dryboot::KernelSegment> segments = dryboot::KernelSegments(image.bytes);
  // The gate hands over 32-bit addresses; the record lies below 4 GiB.
  const bool passed = dryboot::PrintKernelView(static_cast<uint32_t>(result.gateArgument),
                                               static_cast<uint32_t>(result.gateTarget), segments);
  std::fflush(stdout);
  return passed ? kExitKernelEntered : kExitChecksFailed;
}
