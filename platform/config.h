// The platform layer's configuration: \EFI\BOOT\platform.cfg on its own
// volume, UTF-8 text of `key=value` lines.
//
// Blanks and tabs around keys and values are dropped. A line whose first
// non-blank character is `#` is a comment, and empty lines are skipped. A
// value in double quotes keeps its blanks and may hold the escapes \\, \",
// \n, \r and \t. A key that comes twice takes the later value. Unknown keys
// are reported and ignored; a line without `=` or a value that its key
// refuses is an error.
//
// Keys:
//   loader=<path>          the loader on this volume; \EFI\BOOT\nimbboot.efi
//   options=<text>         the loader's load options; none when absent
//   console=text|graphics  the console mode the loader finds; graphics
//   hold=<seconds>         wait between the report and the end of the run
//                          (the screen as the loader left it), 0 to 3600; 0
//   debug-exit=auto|0|1    1: end the run through QEMU's debug-exit device
//                          (port 0xF4) with a code of exitcodes.h; 0: never
//                          write the port; auto: on a machine that SMBIOS
//                          names QEMU. Without the device the run goes on as
//                          with 0; auto
//   wait-key=0|1           1: after the outcome is on the screen, wait for a
//                          key before the end; 0
//   net.time-pxe=0|1       on a network boot, 1 times the firmware's own
//                          download of the boot file before the loader
//                          starts, then fetches it over the network's own
//                          LoadFile; 0
//   keys=<key>+<key>...    the keys held down at start, as the key state
//                          protocol reports them. Modifiers: ctrl, shift,
//                          alt, gui (left ones; also lctrl, lshift, lalt,
//                          lgui) and rctrl, rshift, ralt, rgui. Keys: a to z,
//                          0 to 9, or a keyboard usage in hexadecimal (0x28).
//                          At most kMaxHeldKeys keys, each once; the order is
//                          the order of the report. Names are lower-case.
//                          Given (even empty): these keys, the keyboard is
//                          not read. Absent: the keys held on the keyboard
//                          while the platform starts
//   keys-ignored=0|1       the boot policy's answer: 1 tells the loader not
//                          to read the held keys; 0
//   firmware-protocols=keep|replace  what becomes of a protocol that the
//                          platform serves (console control, key state, boot
//                          policy, Data Hub, UGA Draw, frame buffer info,
//                          device properties, network boot information) when
//                          the firmware has its own: keep the firmware's and
//                          serve none, or put the platform's in its place on
//                          the same handle. Either way the log says so; keep
//   nvram.<name>=<text>    the NVRAM variable <name> under the loader's vendor
//                          GUID, set for good to the text's UTF-8 bytes
//                          without a terminator: non-volatile, boot and
//                          runtime access, on the first start of a run only
//   nvram-hex.<name>=<hex> the same with the bytes in hexadecimal, two digits
//                          each, blanks allowed between bytes
//   nvram-volatile.<name>=<text>, nvram-volatile-hex.<name>=<hex>  the same
//                          for this boot only: volatile (boot and runtime
//                          access), set at every start, gone after a reset
//   nvram-delete.<name>=   the variable <name> under the loader's vendor GUID
//                          is deleted on the first start of a run (the value
//                          stays empty); one that is not there is reported
//   datahub.<name>=<text>  a Data Hub record of the vendor's platform producer
//                          named <name>, whose value is the text in UCS-2 with
//                          a NUL unit behind it
//   datahub-hex.<name>=<hex>  the same with raw bytes for the value (may be
//                          empty)
//   device-properties-hex=<hex>  the blob of device properties that the
//                          device properties protocol gives (may be empty,
//                          any size). Absent: no such protocol, as on
//                          machines without one
//   netboot.dhcp-hex=<hex> the DHCP answer that the network boot information
//                          protocol gives (may be empty)
//   netboot.bsdp-hex=<hex> its boot-service discovery answer (may be empty).
//                          With either key the protocol is there, and it
//                          answers EFI_NOT_FOUND for an answer not given
//   time-read=<path>       a file of this volume that the platform reads
//                          whole through the firmware's file system before
//                          starting the loader, timed with the time stamp
//                          counter (platform: tsc read-start, read-end)
//   time-text=0|1          1: each text of the loader that the platform keeps
//                          off a graphics screen comes behind a time stamp
//                          counter moment (platform: tsc text); 0
//   time-read-extents-hex=<hex> before the loader starts, the platform reads
//                          these extents of one partition through DiskIO
//                          and prints the time in TSC ticks: u32 partition
//                          number, then u64 start and u64 length pairs,
//                          little-endian
// Hexadecimal values are any number of bytes: two digits each, blanks
// allowed between bytes, no limit but the file's size.
// NVRAM values may not be empty (an empty variable cannot exist). Names and
// text values are UTF-8 within U+FFFF. The text and hexadecimal forms of one
// name are one variable or one record, and the set, volatile and delete forms
// of a name are one variable: the later line wins.
// A UTF-8 byte-order mark at the start of the file is skipped. Records and
// variables keep the order of their first line.
// Without any key there is still a key state protocol (nothing held), a boot
// policy protocol (answering 0) and a Data Hub (no vendor records), but no
// device properties and no network boot information protocol.
//
// A new key is a field below, a function that checks and stores its value,
// and a row of the key table in config.cpp. Values stay in the file's buffer,
// which lives as long as the platform layer, so a key that may come on many
// lines (one per variable or record) keeps a list of pointers.
#pragma once

#include "efi/efi.h"

namespace nimb::platform {

constexpr UINT32 kMaxHeldKeys = 8;
constexpr UINT32 kMaxConfigEntries = 32;

// The keyboard as the key state protocol reports it: the modifier mask of a
// USB HID keyboard report and key values of 0x7000 plus the usage.
struct HeldKeys {
  UINT16 modifiers;
  UINT32 count;
  UINT16 keys[kMaxHeldKeys];
};

// What becomes of a configured NVRAM variable.
enum ConfigVariableLife : UINT8 {
  kVariableForGood,   // non-volatile; records are all of this kind
  kVariableThisBoot,  // volatile
  kVariableDeleted,   // no value
};

// One variable or record: the name behind the key's prefix and the value,
// both in the file's buffer.
struct ConfigEntry {
  const char *name;
  const UINT8 *bytes;
  UINT32 size;
  // The value is UTF-8 text (ending in a NUL behind `size` bytes), not bytes
  // given in hexadecimal.
  bool text;
  ConfigVariableLife life;
};

struct ConfigEntryList {
  UINT32 count;
  ConfigEntry entries[kMaxConfigEntries];
};

// Bytes given in hexadecimal, decoded in the file's buffer; `bytes` is null
// when the file gives none, and not null for an empty value.
struct ConfigBytes {
  const UINT8 *bytes;
  UINT32 size;
};

constexpr EFI_CONSOLE_CONTROL_SCREEN_MODE kConsoleNone = EfiConsoleControlScreenMaxValue;

struct PlatformConfig {
  // The loader's path on the platform's own volume.
  const char *loaderPath;
  // The loader's load options; null when the file gives none, in which case
  // the loader gets none at all (not an empty text).
  const char *options;
  // The console mode that the loader finds when it starts; kConsoleNone:
  // no console control at all, as the firmware has none of its own.
  EFI_CONSOLE_CONTROL_SCREEN_MODE consoleMode;
  // Seconds to wait between the report and the end of the run.
  UINT32 holdSeconds;
  // Whether the run ends through the debug-exit device: kDebugExit...
  UINT8 debugExit;
  // Wait for a key once the outcome is on the screen.
  bool waitKey;
  // On a network boot: time the firmware's own download of the boot file
  // before the loader starts (net.time-pxe=1).
  bool timePxeDownload;
  HeldKeys keys;
  // `keys` came from the file: the keyboard is not read.
  bool keysGiven;
  bool keysIgnored;
  // A protocol of the firmware's own gives way to the platform's.
  bool replaceFirmwareProtocols;
  ConfigEntryList nvram;
  ConfigEntryList dataHub;
  ConfigBytes deviceProperties;
  ConfigBytes dhcpResponse;
  ConfigBytes bsdpResponse;
  // The file to read timed before the loader starts; null: none.
  const char *timedReadPath;
  // Every hidden text of the loader gets a moment before it.
  bool timeText;
  ConfigBytes timedExtents;
};

constexpr const char *kDefaultLoaderPath = "\\EFI\\BOOT\\nimbboot.efi";
// On a network boot: the loader's name on the TFTP server.
constexpr const char *kDefaultNetLoaderName = "nimbboot.efi";
constexpr UINT32 kMaxHoldSeconds = 3600;
constexpr UINT8 kDebugExitOff = 0;
constexpr UINT8 kDebugExitOn = 1;
constexpr UINT8 kDebugExitAuto = 2;  // when the machine is QEMU

enum ConfigProblem : UINT32 {
  kConfigUnknownKey,  // reported, not an error
  kConfigNoEquals,
  kConfigBadValue,
};

struct ConfigIssue {
  ConfigProblem problem;
  UINT32 line;        // from 1
  const char *key;    // the whole line for kConfigNoEquals
  const char *value;  // null for kConfigNoEquals
};

typedef void (*ConfigReport)(const ConfigIssue &issue, void *context);

// The room for a key or value as a report echoes it, the NUL counted.
constexpr UINT32 kConfigEchoCapacity = 64;

// `text` as a report may show it on a serial line: printable ASCII as it
// stands, every other byte as \xNN; cut with "..." at the end when it needs
// more than `capacity` - 1 characters. `capacity` is at least 5.
void ConfigEcho(const char *text, char *echo, UINTN capacity);

void ConfigSetDefaults(PlatformConfig *config);

// Parses `size` bytes of `text` into `config`, over the defaults or earlier
// values. The text is cut up in place: `text` must have room for one more
// byte behind `size`, and the strings that `config` gets point into it.
// Returns the number of errors; `report` hears of every issue.
UINT32 ConfigParse(char *text, UINTN size, PlatformConfig *config, ConfigReport report, void *context);

// Hands `answer` to a firmware caller whose buffer has room for `*size`
// bytes: with room enough, copies it and sets `*size` to its size
// (EFI_SUCCESS); otherwise only sets `*size` to the size needed
// (EFI_BUFFER_TOO_SMALL), so that a size of 0 and a null buffer ask for the
// size. An answer not given is EFI_NOT_FOUND, `*size` untouched; a null
// `size`, or a null buffer where bytes are to go, is EFI_INVALID_PARAMETER.
EFI_STATUS ConfigBytesAnswer(const ConfigBytes &answer, void *buffer, UINTN *size);

// UTF-8 to UCS-2 with a NUL unit behind. `*units` gets the number of units
// without the NUL. With a null `destination` only counts; otherwise
// `capacity` units (the NUL counted) must suffice. False for malformed text,
// for a character beyond U+FFFF and for too small a destination.
bool Utf8ToUcs2(const char *text, CHAR16 *destination, UINTN capacity, UINTN *units);

}  // namespace nimb::platform
