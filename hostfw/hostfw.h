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

// A set of ACPI tables as InstallAcpi builds it: an RSDP, an RSDT and (from
// revision 2 on) an XSDT listing `otherTables` and then the FACP; the FACP
// names the FACS, which holds the hardware signature, and the DSDT. All
// checksums are right, unless a length given here makes them cover what the
// table does not hold.
struct AcpiOptions {
  UINT8 rsdpRevision = 2;  // below 2: the 20-byte RSDP of the first version, without XSDT
  bool rsdt = true;        // the RSDP names the RSDT (else its field is 0)
  bool xsdt = true;        // the RSDP names the XSDT (revision 2 and above)
  UINT32 rsdtLength = 0;   // 0: the true length; else the length the RSDT states
  UINT32 xsdtLength = 0;   // the same for the XSDT
  std::vector<std::string> otherTables = {"APIC", "HPET"};  // 4-character signatures ahead of the FACP
  bool facp = true;                                         // the root tables list the FACP
  UINT8 facpRevision = 4;
  UINT32 facpLength = 0;  // 0: 116 bytes up to revision 2, 244 above
  bool dsdt32 = true;     // the FACP's 32-bit DSDT field is filled
  bool dsdt64 = true;     // and its 64-bit one (where the FACP is long enough)
  UINT32 hardwareSignature = 0x4E494D42;
  // The DSDT's OEM table id: up to 8 characters, padded with blanks.
  std::string oemTableId = "NIMBHOST";
  UINT32 oemRevision = 0x00010000;
  UINT32 dsdtLength = 0;  // 0: the true length
  std::vector<EFI_GUID> configurationGuids = {gEfiAcpi20TableGuid};
};

// Where InstallAcpi put the tables; 0 for a table it did not make.
struct AcpiTables {
  UINT64 rsdp = 0;
  UINT64 rsdt = 0;
  UINT64 xsdt = 0;
  UINT64 facp = 0;
  UINT64 facs = 0;
  UINT64 dsdt = 0;
};

// A hard-drive device path node.
struct HardDriveNode {
  UINT32 partition = 1;
  UINT64 start = 0;   // first block
  UINT64 blocks = 0;  // number of blocks
  UINT8 signature[16] = {};
  UINT8 format = 2;         // 1: MBR, 2: GUID partition table
  UINT8 signatureType = 2;  // 0: none, 1: 32-bit MBR signature, 2: GUID
  UINT16 length = 42;       // the node's length field

  // A partition of a GUID partition table, signed with `guid`.
  static HardDriveNode Gpt(const EFI_GUID &guid, UINT32 partition = 1);
  // A partition of an MBR disk whose 32-bit signature is `diskSignature`.
  static HardDriveNode Mbr(UINT32 diskSignature, UINT32 partition = 1);
};

// An in-memory screen behind UGA Draw and the frame buffer info protocol
// (AddScreen). Its pixels lie in firmware memory of the arena, so that the
// frame buffer's address fits 32 bits as on the machines the loader knows.
struct ScreenOptions {
  UINT32 width = 1024;
  UINT32 height = 768;
  UINT32 depth = 32;  // 32 (blue, green, red, reserved) or 16 (5 bits each, red on top)
  UINT32 refresh = 60;
  UINT32 rowBytes = 0;          // 0: width x bytes per pixel; more leaves unused bytes at each row's end
  bool ugaDraw = true;          // UGA Draw on the ConsoleOutHandle
  bool frameBufferInfo = true;  // the frame buffer info protocol, on the same handle
};

// What the frame buffer info protocol's GetInfo reports.
struct FrameBufferFacts {
  UINT64 base = 0;
  UINT32 size = 0;
  UINT32 rowBytes = 0;
  UINT32 width = 0;
  UINT32 height = 0;
  UINT32 depth = 0;
};

// A UGA Blt call that reached the screen, whatever its status.
struct BltCall {
  EFI_UGA_BLT_OPERATION operation;
  UINTN sourceX, sourceY, destinationX, destinationY, width, height, delta;
  EFI_UGA_PIXEL fill;  // a fill's pixel; zero for other operations
  EFI_STATUS status;
};

struct Screen;  // graphics.cpp

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
  // From now on, free pages of the arena and regions declared reserved can
  // be neither read nor written: a stray access by the loader faults and
  // ends the test program. Pages taken later are opened, pages given back
  // are closed again. For tests and fuzz targets that must show that nothing
  // touches memory the loader does not hold.
  void GuardFreeMemory();
  // The key that the next GetMemoryMap returns; changes with every change of
  // the map, pool allocations and frees included.
  UINTN MapKey() const;
  // A pool allocation of the firmware's own between two reads of the memory
  // map, as real firmware makes them: the next GetMemoryMap call after this
  // finds `extraDescriptors` more entries than the one before.
  void GrowMemoryMapOnNextCall(unsigned extraDescriptors);
  // The same, for the n-th GetMemoryMap call from now (1 for the next);
  // with `runtime`, each new entry is a page of runtime data or code, as a
  // runtime driver's allocation between the reads would make it.
  void GrowMemoryMapOnCall(unsigned nth, unsigned extraDescriptors, bool runtime = false);

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

  // --- Data Hub -------------------------------------------------------------
  // Logs a record in the Data Hub, which is installed with the first record.
  // The record has the layout of the vendor's platform records: the standard
  // header naming `producer`, 16 bytes of the producer's own, the sizes of
  // name and value, the name in UCS-2 with its NUL unit, then the value.
  void AddDataHubRecord(const EFI_GUID &producer, const std::u16string &name,
                        const std::vector<uint8_t> &value);
  // A record whose bytes behind the 72-byte standard header are `data` as
  // given, sizes and all; the header's RecordSize is always the true size.
  void AddDataHubRecordData(const EFI_GUID &producer, const std::vector<uint8_t> &data);

  // --- ACPI -------------------------------------------------------------------
  // Builds a set of ACPI tables in the firmware's ACPI memory (see
  // AcpiOptions) and enters its RSDP in the configuration table under each
  // of `options.configurationGuids`, in order. Each call builds a new set.
  AcpiTables InstallAcpi(const AcpiOptions &options);

  // --- Partitions ---------------------------------------------------------------
  // Replaces the device path of `handle` (a device of AddBlockDevice or any
  // handle with a path) by its nodes up to the first hard-drive node,
  // followed by `nodes` and the end node.
  void SetHardDrivePath(EFI_HANDLE handle, const std::vector<HardDriveNode> &nodes);

  // --- Screen ---------------------------------------------------------------
  // Makes an in-memory screen, black, and installs the protocols that
  // `options` asks for. Blt accepts fills and buffer-to-video copies, and
  // refuses a rectangle that does not lie on the screen with
  // EFI_INVALID_PARAMETER. Service names for CallCount and FailCall:
  // "UgaGetMode", "UgaBlt", "FrameBufferGetInfo". A later call makes a new
  // screen in place of the old.
  void AddScreen(const ScreenOptions &options = {});
  void SetUgaDrawPresent(bool present);
  void SetFrameBufferInfoPresent(bool present);
  // The screen's own facts, which GetInfo reports until SetFrameBufferFacts.
  FrameBufferFacts ScreenFacts() const;
  void SetFrameBufferFacts(const FrameBufferFacts &facts);
  // A pixel as it stands in the screen's memory: with 32 bits blue | green
  // << 8 | red << 16 | reserved << 24, with 16 bits blue | green << 5 | red
  // << 10.
  UINT32 ScreenPixel(UINT32 x, UINT32 y) const;
  const std::vector<BltCall> &BltCalls() const;

  // --- ExitBootServices ---------------------------------------------------
  bool BootServicesExited() const;
  // Makes the call gate come back to the loader (after recording it) instead
  // of ending the run, as a kernel that returns would.
  void SetGateReturns(bool returns);
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
  // CopyMem and SetMem have no status: they never fail.
  void FailCall(const std::string &name, unsigned nth = 1, EFI_STATUS status = EFI_DEVICE_ERROR,
                const EFI_GUID *protocol = nullptr);
  // The n-th pool allocation from now of exactly `size` bytes fails.
  void FailPoolAllocationOfSize(UINTN size, unsigned nth = 1, EFI_STATUS status = EFI_OUT_OF_RESOURCES);
  // How often a service was called since the firmware was made.
  unsigned CallCount(const std::string &name) const;
  // Every service called so far, by name, with its count.
  const std::map<std::string, unsigned> &CallCounts() const;

 private:
  struct State;
  std::unique_ptr<State> s_;
  std::shared_ptr<Screen> screen_;  // null until AddScreen
  friend struct Services;
};

}  // namespace hostfw
