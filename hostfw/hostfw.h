// hostfw: an in-process UEFI firmware for the host. It gives the loader's own
// code a system table, boot services, runtime services and protocols that
// behave like a real machine's, over real memory at the addresses asked for,
// so that unit tests and dryboot run the loader unchanged.
//
// One Firmware is active at a time (the service tables are plain function
// pointers of the firmware's calling convention and find the active instance
// through a global). A Firmware made while another lives takes over until it
// is destroyed: the arena's pages of the first are kept aside meanwhile and
// put back then, so that the first goes on as it was. Its tables lie at the
// same addresses as the second's.
//
// Everything is recorded so that a test can look at what the loader asked
// for, and every service can be made to fail on demand. A call that is
// refused (by fault injection, or because boot services have ended) has no
// effect: it shows only in CallCount and ViolationsAfterExit, never in the
// other records (ConOutCalls, OpenedNames, ConsoleModeCalls, ...).
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "efi/efi.h"

namespace hostfw {

// Physical memory that page allocations come from. The range is mapped into
// the test process at exactly these addresses, so that an address the loader
// is given (or asks for) is usable as a pointer as it stands. It lies below
// 2 GiB, where the sanitizers leave room for it.
constexpr UINT64 kArenaBase = 0x00100000;
constexpr UINT64 kArenaLimit = 0x40000000;

// The stride of the memory map: bigger than the structure, as on real
// firmware, so that a loader that walks the map by sizeof goes wrong.
constexpr UINTN kDescriptorSize = 48;

// How a Run ended.
enum class RunEnd {
  Returned,       // the entry function returned its status
  Exited,         // gBS->Exit was called; `status` is its ExitStatus
  Reset,          // gRT->ResetSystem was called; `status` is its ResetStatus
  KernelEntered,  // the call gate was reached; `gateArgument`, `gateTarget`
  Halted,         // the loader stopped the machine (nowhere left to go)
};

struct RunResult {
  RunEnd end = RunEnd::Returned;
  EFI_STATUS status = 0;
  EFI_RESET_TYPE resetType = EfiResetCold;
  UINT64 gateAddress = 0;
  UINT64 gateArgument = 0;
  UINT64 gateTarget = 0;
  bool interruptsDisabled = false;
};

struct Variable {
  std::u16string name;
  EFI_GUID guid;
  UINT32 attributes = 0;
  std::vector<uint8_t> data;
};

struct EventRecord {
  EFI_EVENT event = nullptr;
  UINT32 type = 0;
  EFI_TPL tpl = 0;
  EFI_EVENT_NOTIFY notify = nullptr;
  void *context = nullptr;
  EFI_TIMER_DELAY timerType = TimerCancel;
  UINT64 triggerTime = 0;
  bool closed = false;
};

// A call the loader made to a console control protocol, for tests that count.
struct ConsoleModeCall {
  bool set;  // SetMode (true) or GetMode (false)
  EFI_CONSOLE_CONTROL_SCREEN_MODE mode;
};

class Firmware {
 public:
  Firmware();
  ~Firmware();
  Firmware(const Firmware &) = delete;
  Firmware &operator=(const Firmware &) = delete;

  // The active instance, or null.
  static Firmware *Active();

  EFI_SYSTEM_TABLE *SystemTable();
  EFI_BOOT_SERVICES *BootServices();
  EFI_RUNTIME_SERVICES *RuntimeServices();
  EFI_HANDLE ImageHandle();
  EFI_LOADED_IMAGE_PROTOCOL *LoadedImage();

  // --- Running the loader --------------------------------------------------
  // Calls `entry(ImageHandle, SystemTable)` and comes back however it ends:
  // by returning, through Exit, ResetSystem, the call gate or a halt.
  RunResult Run(EFI_IMAGE_ENTRY_POINT entry);
  // Runs any piece of loader code under the same catch, for tests that call a
  // routine which may end the run (Fatal, ExitBoot).
  RunResult Call(const std::function<void()> &body);

  // --- Memory --------------------------------------------------------------
  // The memory map as GetMemoryMap would give it now.
  std::vector<EFI_MEMORY_DESCRIPTOR> MemoryMap() const;
  // Declares a region of the arena with a type of its own (runtime code or
  // data, reserved, ACPI, MMIO, ...). MMIO may lie outside the arena and is
  // then only described, never mapped.
  void AddMemoryRegion(EFI_MEMORY_TYPE type, UINT64 base, UINT64 pages, UINT64 attribute);
  // Page allocations the loader holds now (the firmware's own regions and
  // those of AddMemoryRegion are not counted).
  UINT64 AllocatedPages() const;
  // Pool blocks the loader holds now (the firmware's own are not counted).
  size_t LivePoolBlocks() const;
  // Calls of the allocation services, for tests that count them.
  unsigned AllocatePoolCalls() const;
  unsigned FreePoolCalls() const;
  unsigned AllocatePagesCalls() const;
  unsigned FreePagesCalls() const;
  // The key that the next GetMemoryMap returns; changes with every change of
  // the map, pool allocations and frees included.
  UINTN MapKey() const;
  // A pool allocation of the firmware's own between two reads of the memory
  // map, as real firmware makes them: the next GetMemoryMap call after this
  // finds `extraDescriptors` more entries than the one before.
  void GrowMemoryMapOnNextCall(unsigned extraDescriptors);

  // --- Handles and protocols ----------------------------------------------
  EFI_HANDLE NewHandle();
  void InstallProtocol(EFI_HANDLE handle, const EFI_GUID &guid, void *interface);
  void UninstallProtocol(EFI_HANDLE handle, const EFI_GUID &guid);

  // --- Boot image and load options ----------------------------------------
  // Load options as the firmware hands them over: `bytes` exactly as given.
  void SetLoadOptionsBytes(const std::vector<uint8_t> &bytes);
  // Wide text, with (by default) its terminating zero unit included.
  void SetLoadOptions(const std::u16string &text, bool withTerminator = true);
  // Makes `device` the loaded image's DeviceHandle.
  void SetBootDevice(EFI_HANDLE device);

  // --- Volumes ------------------------------------------------------------
  // A new device handle with a DevicePath (a hard-drive node numbered
  // `partition`) and a SimpleFileSystem over the host directory `root`.
  // File names match without regard to case, as on a FAT volume.
  EFI_HANDLE AddDirectoryVolume(const std::string &root, UINT32 partition = 1);
  // BlockIO and DiskIO over the bytes of a disk image; with `partitionStart`
  // and `partitionBlocks` set, over that part of it only (a partition).
  EFI_HANDLE AddBlockDevice(std::shared_ptr<std::vector<uint8_t>> image, UINT32 blockSize = 512,
                            UINT64 partitionStart = 0, UINT64 partitionBlocks = 0);
  // Sets the modification time that GetInfo reports for a file of a
  // directory volume (seconds since 1970, UTC); by default the host's.
  void SetFileTime(const std::string &hostPath, int64_t seconds);
  // Device path of a handle made here, for tests that build on it.
  EFI_DEVICE_PATH_PROTOCOL *DevicePathOf(EFI_HANDLE handle);
  // Installs a device path protocol on a handle, from raw bytes (copied).
  void SetDevicePath(EFI_HANDLE handle, const std::vector<uint8_t> &bytes);
  // Open EFI_FILE handles of all directory volumes, for leak checks.
  size_t OpenFiles() const;
  // Every name passed to EFI_FILE Open, as UTF-8, in call order.
  const std::vector<std::string> &OpenedNames() const;
  // Names whose handle was closed, in call order.
  const std::vector<std::string> &ClosedNames() const;

  // --- Console ------------------------------------------------------------
  // Every OutputString call on ConOut (and StdErr), one string each. Without
  // ConOut the system table's ConOut is null; ConsoleOutHandle stays.
  const std::vector<std::u16string> &ConOutCalls() const;
  const std::vector<std::u16string> &StdErrCalls() const;
  // All ConOut output as UTF-8, units of 0x80 and above written as
  // replacement characters as a terminal would show them.
  std::string ConOutText() const;
  void SetConOutPresent(bool present);
  void SetStdErrPresent(bool present);

  // Console control protocol: installed by default, starting in `mode`.
  void SetConsoleControlPresent(bool present);
  void SetConsoleMode(EFI_CONSOLE_CONTROL_SCREEN_MODE mode);
  EFI_CONSOLE_CONTROL_SCREEN_MODE ConsoleMode() const;
  const std::vector<ConsoleModeCall> &ConsoleModeCalls() const;

  // --- Events -------------------------------------------------------------
  const std::vector<EventRecord> &Events() const;
  // Runs the notify function of an event, as the firmware's timer would: not
  // for a closed event, a cancelled timer, or after ExitBootServices.
  void FireEvent(EFI_EVENT event);

  // --- Runtime services ---------------------------------------------------
  void PutVariable(const std::u16string &name, const EFI_GUID &guid, UINT32 attributes,
                   const std::vector<uint8_t> &data);
  const Variable *FindVariable(const std::u16string &name, const EFI_GUID &guid) const;
  // What SetVirtualAddressMap was given, as copied at the call.
  const std::vector<EFI_MEMORY_DESCRIPTOR> &VirtualMap() const;
  bool VirtualMapSet() const;

  // --- Configuration tables -----------------------------------------------
  void AddConfigurationTable(const EFI_GUID &guid, void *table);

  // --- ExitBootServices ---------------------------------------------------
  bool BootServicesExited() const;
  // Calls into boot services, the console or any other boot-time protocol
  // after ExitBootServices, by name. Each is refused with EFI_UNSUPPORTED,
  // except Exit, which still ends the run. The system table keeps its console
  // and boot services pointers, so that such calls reach the firmware and show.
  const std::vector<std::string> &ViolationsAfterExit() const;

  // --- Fault injection ----------------------------------------------------
  // The n-th allocation from now (AllocatePool or AllocatePages, counted
  // together, 1 for the next) fails with `status`.
  void FailAllocation(unsigned nth, EFI_STATUS status = EFI_OUT_OF_RESOURCES);
  // The n-th call from now of the named service fails with `status`. Names
  // are the services' own: "AllocatePool", "HandleProtocol", "LocateProtocol",
  // "GetMode", "SetMode", "OpenVolume", "Open", "Read", "GetInfo",
  // "GetVariable", "SetTimer", "CreateEvent", "GetMemoryMap", ... (where two
  // protocols share a function name, the text output's and BlockIO's carry a
  // prefix: "TextReset", "TextSetMode", "BlockReset"). With
  // `protocol` set, only HandleProtocol/LocateProtocol calls for that GUID
  // are counted (and those of the other services that take a protocol GUID).
  void FailCall(const std::string &name, unsigned nth = 1, EFI_STATUS status = EFI_DEVICE_ERROR,
                const EFI_GUID *protocol = nullptr);
  // How often a service was called since the firmware was made.
  unsigned CallCount(const std::string &name) const;

 private:
  struct State;
  std::unique_ptr<State> s_;
  friend struct Services;
};

}  // namespace hostfw
