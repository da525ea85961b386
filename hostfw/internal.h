// The host firmware's own state and the helpers that its parts share. Only
// hostfw/*.cpp include this; tests and tools see hostfw.h alone.
#pragma once

#include <csetjmp>
#include <cstdint>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "efi/datahub.h"
#include "hostfw/hostfw.h"

namespace hostfw {

// --- Memory -------------------------------------------------------------------

enum class Owner {
  Loader,    // pages the loader asked for: counted, and freeable by the loader
  Firmware,  // the firmware's own regions (its tables, its own allocations)
  Declared,  // regions of AddMemoryRegion
};

// A range of the arena that is not free memory.
struct PageRange {
  UINT64 pages;
  EFI_MEMORY_TYPE type;
  UINT64 attribute;
  Owner owner;
};

// A pool block handed to the loader.
struct PoolBlock {
  size_t size;
  EFI_MEMORY_TYPE type;
};

// The contents of a range, kept while another Firmware owns the arena.
struct SavedRange {
  UINT64 base;
  std::vector<uint8_t> bytes;
};

// The firmware's tables, laid out in its runtime data region.
constexpr size_t kMaxConfigurationTables = 128;
struct RuntimeData {
  EFI_SYSTEM_TABLE system;
  EFI_RUNTIME_SERVICES runtime;
  EFI_BOOT_SERVICES boot;
  CHAR16 vendor[32];
  EFI_CONFIGURATION_TABLE configuration[kMaxConfigurationTables];
};
constexpr UINT64 kRuntimeDataPages = 4;
constexpr UINT64 kRuntimeCodePages = 2;
static_assert(sizeof(RuntimeData) <= kRuntimeDataPages * EFI_PAGE_SIZE);

// --- Handles --------------------------------------------------------------------

struct InterfaceRecord {
  EFI_GUID guid;
  void *interface;
};

// A handle is the address of its record.
struct HandleRecord {
  std::vector<InterfaceRecord> interfaces;
};

// --- Events ---------------------------------------------------------------------

// An event is the address of its token; the token names its record.
struct EventToken {
  size_t index;
};

// --- Console --------------------------------------------------------------------

struct TextOutput {
  EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL protocol;
  SIMPLE_TEXT_OUTPUT_MODE mode;
  std::vector<std::u16string> calls;
};

// --- Volumes and devices --------------------------------------------------------

struct Volume {
  EFI_SIMPLE_FILE_SYSTEM_PROTOCOL fileSystem;
  std::string root;  // canonical host path of the volume's root directory
};

// An open EFI_FILE. The protocol is the first member: the handle the loader
// holds is its address.
struct FileObject {
  EFI_FILE_PROTOCOL protocol;
  Volume *volume = nullptr;
  std::vector<std::string> components;  // host names from the volume's root
  bool directory = false;
  int fd = -1;                       // open host file, for a file
  UINT64 position = 0;               // byte offset, or entry index for a directory
  std::vector<std::string> entries;  // directory listing, taken at open and rewind
  std::string openedName;            // the name given to Open, as UTF-8

  FileObject() = default;
  FileObject(const FileObject &) = delete;
  FileObject &operator=(const FileObject &) = delete;
  ~FileObject();
};

struct BlockDevice {
  EFI_BLOCK_IO_PROTOCOL blockIo;
  EFI_DISK_IO_PROTOCOL diskIo;
  EFI_BLOCK_IO_MEDIA media;
  std::shared_ptr<std::vector<uint8_t>> image;
  UINT64 offset;  // of the view in the image, in bytes
  UINT64 size;    // of the view, in bytes
};

// --- Data Hub -------------------------------------------------------------------

struct DataHub {
  EFI_DATA_HUB_PROTOCOL protocol;
  EFI_HANDLE handle = nullptr;
  // Each record is exactly as long as its RecordSize says; the record at
  // index i has the monotonic count i + 1.
  std::vector<std::vector<uint8_t>> records;
};

// --- Runs -----------------------------------------------------------------------

// One Run or Call in progress: where Exit, ResetSystem and the call gate
// come back to.
struct RunFrame {
  std::jmp_buf jump;
  RunResult result;
};

// --- Fault injection ------------------------------------------------------------

struct Fault {
  std::string name;    // service name; empty for an allocation fault
  unsigned remaining;  // calls to go; the call that brings it to 0 fails
  EFI_STATUS status;
  bool hasProtocol;
  EFI_GUID protocol;
  bool hasSize = false;  // an allocation of exactly `size` bytes only
  UINTN size = 0;
};

// --- The whole state --------------------------------------------------------------

struct Firmware::State {
  // Memory.
  std::map<UINT64, PageRange> ranges;                 // in the arena, by base address
  std::vector<EFI_MEMORY_DESCRIPTOR> outsideRegions;  // declared beyond the arena
  std::map<void *, PoolBlock> pool;
  UINTN mapKey = 1;
  unsigned pendingGrowth = 0;
  unsigned growthCountdown = 0;  // GetMemoryMap calls until growthLater applies
  unsigned growthLater = 0;
  bool growthRuntime = false;  // the growth's pages are runtime data and code
  std::vector<SavedRange> saved;
  bool guarded = false;  // GuardFreeMemory

  // Tables.
  RuntimeData *tables = nullptr;

  // Handles and the objects behind them.
  std::vector<std::unique_ptr<HandleRecord>> handles;
  std::vector<std::unique_ptr<std::vector<uint8_t>>> devicePaths;  // kept for the firmware's life
  EFI_HANDLE imageHandle = nullptr;
  EFI_LOADED_IMAGE_PROTOCOL loadedImage = {};
  std::vector<uint8_t> loadOptions;
  unsigned nextPciDevice = 1;
  std::map<const void *, std::pair<unsigned, UINT32>> disks;  // image -> PCI device, partitions so far

  // Console.
  TextOutput conOut = {};
  TextOutput stdErr = {};
  EFI_HANDLE conOutHandle = nullptr;
  EFI_HANDLE stdErrHandle = nullptr;
  EFI_CONSOLE_CONTROL_PROTOCOL consoleControl = {};
  EFI_HANDLE consoleControlHandle = nullptr;
  EFI_CONSOLE_CONTROL_SCREEN_MODE consoleMode = EfiConsoleControlScreenGraphics;
  std::vector<ConsoleModeCall> consoleModeCalls;

  // Events.
  std::vector<EventRecord> events;
  std::vector<std::unique_ptr<EventToken>> eventTokens;
  EFI_TPL tpl = TPL_APPLICATION;

  // Runtime services.
  std::vector<Variable> variables;
  std::vector<EFI_MEMORY_DESCRIPTOR> virtualMap;
  bool virtualMapSet = false;
  bool exited = false;
  bool gateReturns = false;
  std::vector<std::string> violations;

  // Volumes and devices.
  std::vector<std::unique_ptr<Volume>> volumes;
  std::vector<std::unique_ptr<FileObject>> files;
  std::vector<std::string> openedNames;
  std::vector<std::string> closedNames;
  std::map<std::string, int64_t> fileTimes;  // by canonical host path
  std::vector<std::unique_ptr<BlockDevice>> blockDevices;

  // The Data Hub, made with its first record (datahub.cpp).
  std::unique_ptr<DataHub> dataHub;

  // Runs and faults.
  std::vector<std::unique_ptr<RunFrame>> runs;
  std::vector<Fault> faults;
  std::map<std::string, unsigned> callCounts;
};

// The way in for the services, which find the active firmware through it.
struct Services {
  using State = Firmware::State;
  // The active firmware's state; a service called with none alive is a
  // misuse of hostfw and aborts.
  static State &Active();
};
using State = Services::State;

// --- Shared helpers (firmware.cpp) ---------------------------------------------

// Stops the test program with a message: hostfw was used in a way it cannot
// serve (not a loader error, which gets a status).
[[noreturn]] void Misuse(const char *format, ...) __attribute__((format(printf, 1, 2)));

// Every boot-time service and protocol function begins here: the call is
// counted; after ExitBootServices it is recorded as a violation and refused;
// otherwise an injected fault may refuse it. Returns true when the call must
// fail at once, with `*failure` as its status and no other effect.
bool Refused(State &s, const char *name, EFI_STATUS *failure, const EFI_GUID *protocol = nullptr,
             const UINTN *size = nullptr);
// For CopyMem and SetMem, which have no status to fail with: counted, and
// refused (as a violation) only after ExitBootServices; a fault asked for
// them is never due. Skipping the copy would leave the caller's buffer as
// the allocator left it, which no firmware does.
bool CalledAfterExit(State &s, const char *name);
// The same for the runtime services, which stay callable after ExitBootServices.
bool RefusedAtRuntime(State &s, const char *name, EFI_STATUS *failure);
// A boot service slot the host firmware does not implement: the call is
// counted under `name`, reported on stderr and refused.
EFI_STATUS Unprovided(const char *name);

// The innermost Run or Call; `what` is what needs one, for the message when
// there is none (a misuse: the code under test belongs in Firmware::Call).
RunFrame &CurrentRun(State &s, const char *what);
// Ends the innermost Run or Call.
[[noreturn]] void EndRun(State &s, RunEnd end, EFI_STATUS status);

void UpdateTableCrc(EFI_TABLE_HEADER *header, size_t size);
void UpdateSystemTableCrc(State &s);
UINT32 Crc32(const void *data, size_t size);

std::string Utf16ToUtf8(const std::u16string &text);
std::u16string Utf8ToUtf16(const std::string &text);
size_t WideLength(const CHAR16 *text);

// Seconds since 1970 as an EFI_TIME in UTC, without a time zone, as a FAT
// volume reports it (runtime.cpp).
EFI_TIME EfiTimeFromSeconds(int64_t seconds);

// --- Handles (handles.cpp) ------------------------------------------------------

HandleRecord *FindHandle(State &s, EFI_HANDLE handle);
// The protocol on the handle (its interface may be null), or null without it.
InterfaceRecord *FindProtocol(State &s, EFI_HANDLE handle, const EFI_GUID &guid);
void *FindInterface(State &s, EFI_HANDLE handle, const EFI_GUID &guid);
EFI_HANDLE AddHandle(State &s);
void PutInterface(State &s, EFI_HANDLE handle, const EFI_GUID &guid, void *interface);
bool SameGuid(const EFI_GUID &a, const EFI_GUID &b);
// Keeps `bytes` for the firmware's life and installs them as the handle's device path.
void InstallDevicePath(State &s, EFI_HANDLE handle, std::vector<uint8_t> bytes);
void InstallHandleServices(EFI_BOOT_SERVICES &bs);
void InitLoadedImage(State &s);

// Device path pieces, appended to `path`.
void AppendHardwareNodes(std::vector<uint8_t> &path, unsigned pciDevice);
void AppendHardDriveNode(std::vector<uint8_t> &path, UINT32 partition, UINT64 start, UINT64 size,
                         const EFI_GUID &signature);
void AppendFileNode(std::vector<uint8_t> &path, const std::u16string &name);
void AppendEndNode(std::vector<uint8_t> &path);
// A partition signature that is the same on every run and differs between partitions.
EFI_GUID PartitionSignature(unsigned disk, UINT32 partition);

// --- Memory (memory.cpp) --------------------------------------------------------

void MapArena();
// Empties the arena's pages and opens them all (its bookkeeping is the caller's).
void ClearArena();
// Closes the free and the reserved pages of `s` (GuardFreeMemory).
void ApplyGuard(State &s);
// Takes pages top-down for the firmware itself, filled with `fill`.
UINT64 AllocateFirmwarePages(State &s, EFI_MEMORY_TYPE type, UINT64 pages, uint8_t fill);
// A pool block that the firmware hands to the caller (it counts as the loader's).
void *AllocateLoaderPool(State &s, size_t size, EFI_MEMORY_TYPE type);
void SaveArena(State &s);
void RestoreArena(State &s);
void FreeAllPool(State &s);
void InstallMemoryServices(EFI_BOOT_SERVICES &bs);

// --- The other parts ------------------------------------------------------------

void InitConsoles(State &s);                            // console.cpp
void InstallEventServices(EFI_BOOT_SERVICES &bs);       // events.cpp
void InstallRuntimeServices(EFI_RUNTIME_SERVICES &rt);  // runtime.cpp

}  // namespace hostfw
