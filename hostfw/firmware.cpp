// The firmware as a whole: which instance is active, its tables, the runs of
// loader code and the ways they end, fault injection and the helpers that
// the other parts share.
#include <algorithm>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <new>

#include "hostfw/internal.h"

namespace hostfw {

namespace {

// Live instances, oldest first; the last is the active one.
std::vector<Firmware *> gInstances;

constexpr UINT32 kSpecificationRevision = (2 << 16) | 70;
constexpr UINT32 kFirmwareRevision = 0x00010000;
const char16_t kFirmwareVendor[] = u"hostfw";

// --- Image services -------------------------------------------------------------

EFI_STATUS EFIAPI Exit(EFI_HANDLE ImageHandle, EFI_STATUS ExitStatus, UINTN, CHAR16 *) {
  State &s = Services::Active();
  EFI_STATUS failure;
  // After ExitBootServices the call is a violation, but the loader cannot go
  // on from an Exit that comes back: the run ends all the same.
  if (Refused(s, "Exit", &failure) && !s.exited)
    return failure;
  if (ImageHandle != s.imageHandle)
    return EFI_INVALID_PARAMETER;
  EndRun(s, RunEnd::Exited, ExitStatus);
}

EFI_STATUS EFIAPI ExitBootServices(EFI_HANDLE ImageHandle, UINTN MapKey) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "ExitBootServices", &failure))
    return failure;
  if (ImageHandle != s.imageHandle || MapKey != s.mapKey)
    return EFI_INVALID_PARAMETER;
  s.exited = true;
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI LoadImage(BOOLEAN, EFI_HANDLE, EFI_DEVICE_PATH_PROTOCOL *, VOID *, UINTN, EFI_HANDLE *) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "LoadImage", &failure))
    return failure;
  return EFI_UNSUPPORTED;
}

EFI_STATUS EFIAPI StartImage(EFI_HANDLE, UINTN *, CHAR16 **) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "StartImage", &failure))
    return failure;
  return EFI_UNSUPPORTED;
}

#define HOSTFW_UNPROVIDED(Name)          \
  EFI_STATUS EFIAPI Unprovided##Name() { \
    return Unprovided(#Name);            \
  }
HOSTFW_UNPROVIDED(RegisterProtocolNotify)
HOSTFW_UNPROVIDED(LocateHandle)
HOSTFW_UNPROVIDED(LocateDevicePath)
HOSTFW_UNPROVIDED(InstallConfigurationTable)
HOSTFW_UNPROVIDED(UnloadImage)
HOSTFW_UNPROVIDED(GetNextMonotonicCount)
HOSTFW_UNPROVIDED(ConnectController)
HOSTFW_UNPROVIDED(DisconnectController)
HOSTFW_UNPROVIDED(OpenProtocol)
HOSTFW_UNPROVIDED(CloseProtocol)
HOSTFW_UNPROVIDED(OpenProtocolInformation)
HOSTFW_UNPROVIDED(ProtocolsPerHandle)
HOSTFW_UNPROVIDED(InstallMultipleProtocolInterfaces)
HOSTFW_UNPROVIDED(UninstallMultipleProtocolInterfaces)
HOSTFW_UNPROVIDED(CreateEventEx)
#undef HOSTFW_UNPROVIDED

EFI_STATUS EFIAPI CalculateCrc32(const VOID *Data, UINTN DataSize, UINT32 *Crc32Out) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, "CalculateCrc32", &failure))
    return failure;
  if (Data == nullptr || DataSize == 0 || Crc32Out == nullptr)
    return EFI_INVALID_PARAMETER;
  *Crc32Out = Crc32(Data, DataSize);
  return EFI_SUCCESS;
}

template <typename F>
void *Slot(F *function) {
  return reinterpret_cast<void *>(function);
}

void FillBootServices(EFI_BOOT_SERVICES &bs) {
  bs.Hdr.Signature = EFI_BOOT_SERVICES_SIGNATURE;
  bs.Hdr.Revision = kSpecificationRevision;
  bs.Hdr.HeaderSize = sizeof(EFI_BOOT_SERVICES);
  InstallMemoryServices(bs);
  InstallEventServices(bs);
  InstallHandleServices(bs);
  bs.RegisterProtocolNotify = Slot(UnprovidedRegisterProtocolNotify);
  bs.LocateHandle = Slot(UnprovidedLocateHandle);
  bs.LocateDevicePath = Slot(UnprovidedLocateDevicePath);
  bs.InstallConfigurationTable = Slot(UnprovidedInstallConfigurationTable);
  bs.LoadImage = LoadImage;
  bs.StartImage = StartImage;
  bs.Exit = Exit;
  bs.UnloadImage = Slot(UnprovidedUnloadImage);
  bs.ExitBootServices = ExitBootServices;
  bs.GetNextMonotonicCount = Slot(UnprovidedGetNextMonotonicCount);
  bs.ConnectController = Slot(UnprovidedConnectController);
  bs.DisconnectController = Slot(UnprovidedDisconnectController);
  bs.OpenProtocol = Slot(UnprovidedOpenProtocol);
  bs.CloseProtocol = Slot(UnprovidedCloseProtocol);
  bs.OpenProtocolInformation = Slot(UnprovidedOpenProtocolInformation);
  bs.ProtocolsPerHandle = Slot(UnprovidedProtocolsPerHandle);
  bs.InstallMultipleProtocolInterfaces = Slot(UnprovidedInstallMultipleProtocolInterfaces);
  bs.UninstallMultipleProtocolInterfaces = Slot(UnprovidedUninstallMultipleProtocolInterfaces);
  bs.CalculateCrc32 = Slot(CalculateCrc32);
  bs.CreateEventEx = Slot(UnprovidedCreateEventEx);
  UpdateTableCrc(&bs.Hdr, sizeof(bs));
}

bool FaultMatches(const Fault &fault, const char *name, const EFI_GUID *protocol, const UINTN *size) {
  if (fault.hasSize && (size == nullptr || *size != fault.size))
    return false;
  if (fault.name.empty()) {
    if (std::strcmp(name, "AllocatePool") != 0 && std::strcmp(name, "AllocatePages") != 0)
      return false;
  } else if (fault.name != name) {
    return false;
  }
  return !fault.hasProtocol || (protocol != nullptr && SameGuid(*protocol, fault.protocol));
}

// Counts the call against the pending faults; true when one of them falls due.
bool TakeFault(State &s, const char *name, const EFI_GUID *protocol, EFI_STATUS *failure,
               const UINTN *size = nullptr) {
  bool due = false;
  for (Fault &fault : s.faults) {
    if (!FaultMatches(fault, name, protocol, size))
      continue;
    if (--fault.remaining == 0 && !due) {
      due = true;
      *failure = fault.status;
    }
  }
  s.faults.erase(
      std::remove_if(s.faults.begin(), s.faults.end(), [](const Fault &f) { return f.remaining == 0; }),
      s.faults.end());
  return due;
}

}  // namespace

// Table slots that the host firmware does not implement: a call is counted
// under the slot's name, reported, and refused.
EFI_STATUS Unprovided(const char *name) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (Refused(s, name, &failure))
    return failure;
  std::fprintf(stderr, "hostfw: %s is not provided\n", name);
  return EFI_UNSUPPORTED;
}

// --- Shared helpers -----------------------------------------------------------------

State &Services::Active() {
  if (gInstances.empty())
    Misuse("a firmware service was called while no hostfw::Firmware exists");
  return *gInstances.back()->s_;
}

void Misuse(const char *format, ...) {
  std::fputs("hostfw: ", stderr);
  va_list arguments;
  va_start(arguments, format);
  std::vfprintf(stderr, format, arguments);
  va_end(arguments);
  std::fputc('\n', stderr);
  std::abort();
}

bool CalledAfterExit(State &s, const char *name) {
  s.callCounts[name]++;
  if (s.exited)
    s.violations.push_back(name);
  return s.exited;
}

bool Refused(State &s, const char *name, EFI_STATUS *failure, const EFI_GUID *protocol, const UINTN *size) {
  if (CalledAfterExit(s, name)) {
    *failure = EFI_UNSUPPORTED;
    return true;
  }
  return TakeFault(s, name, protocol, failure, size);
}

bool RefusedAtRuntime(State &s, const char *name, EFI_STATUS *failure) {
  s.callCounts[name]++;
  return TakeFault(s, name, nullptr, failure);
}

RunFrame &CurrentRun(State &s, const char *what) {
  if (s.runs.empty())
    Misuse("%s was reached outside Firmware::Run or Call: run the code under test in fw.Call", what);
  return *s.runs.back();
}

void EndRun(State &s, RunEnd end, EFI_STATUS status) {
  const char *what = end == RunEnd::Exited          ? "Exit"
                     : end == RunEnd::Reset         ? "ResetSystem"
                     : end == RunEnd::KernelEntered ? "the call gate"
                                                    : "MachineHalt";
  RunFrame &frame = CurrentRun(s, what);
  frame.result.end = end;
  frame.result.status = status;
  std::longjmp(frame.jump, 1);
}

UINT32 Crc32(const void *data, size_t size) {
  const auto *bytes = static_cast<const uint8_t *>(data);
  UINT32 crc = 0xFFFFFFFF;
  for (size_t i = 0; i < size; i++) {
    crc ^= bytes[i];
    for (int bit = 0; bit < 8; bit++)
      crc = (crc >> 1) ^ (0xEDB88320 & (0 - (crc & 1)));
  }
  return ~crc;
}

void UpdateTableCrc(EFI_TABLE_HEADER *header, size_t size) {
  header->CRC32 = 0;
  header->CRC32 = Crc32(header, size);
}

void UpdateSystemTableCrc(State &s) {
  UpdateTableCrc(&s.tables->system.Hdr, sizeof(EFI_SYSTEM_TABLE));
}

size_t WideLength(const CHAR16 *text) {
  size_t length = 0;
  while (text[length] != 0)
    length++;
  return length;
}

std::string Utf16ToUtf8(const std::u16string &text) {
  std::string out;
  for (size_t i = 0; i < text.size(); i++) {
    uint32_t c = text[i];
    if (c >= 0xD800 && c < 0xDC00 && i + 1 < text.size() && text[i + 1] >= 0xDC00 && text[i + 1] < 0xE000) {
      c = 0x10000 + ((c - 0xD800) << 10) + (text[++i] - 0xDC00);
    } else if (c >= 0xD800 && c < 0xE000) {
      c = 0xFFFD;
    }
    if (c < 0x80) {
      out += char(c);
    } else if (c < 0x800) {
      out += char(0xC0 | (c >> 6));
      out += char(0x80 | (c & 0x3F));
    } else if (c < 0x10000) {
      out += char(0xE0 | (c >> 12));
      out += char(0x80 | ((c >> 6) & 0x3F));
      out += char(0x80 | (c & 0x3F));
    } else {
      out += char(0xF0 | (c >> 18));
      out += char(0x80 | ((c >> 12) & 0x3F));
      out += char(0x80 | ((c >> 6) & 0x3F));
      out += char(0x80 | (c & 0x3F));
    }
  }
  return out;
}

std::u16string Utf8ToUtf16(const std::string &text) {
  std::u16string out;
  size_t i = 0;
  while (i < text.size()) {
    uint8_t lead = uint8_t(text[i]);
    int extra = lead < 0x80             ? 0
                : (lead & 0xE0) == 0xC0 ? 1
                : (lead & 0xF0) == 0xE0 ? 2
                : (lead & 0xF8) == 0xF0 ? 3
                                        : -1;
    uint32_t c = extra == 0 ? lead : extra == 1 ? lead & 0x1F : extra == 2 ? lead & 0x0F : lead & 0x07;
    bool valid = extra >= 0 && i + extra < text.size();
    for (int k = 1; valid && k <= extra; k++) {
      uint8_t next = uint8_t(text[i + k]);
      valid = (next & 0xC0) == 0x80;
      c = (c << 6) | (next & 0x3F);
    }
    if (!valid) {
      out += char16_t(0xFFFD);
      i++;
      continue;
    }
    i += extra + 1;
    if (c >= 0x10000) {
      out += char16_t(0xD800 + ((c - 0x10000) >> 10));
      out += char16_t(0xDC00 + ((c - 0x10000) & 0x3FF));
    } else {
      out += char16_t(c);
    }
  }
  return out;
}

// --- Lifecycle ------------------------------------------------------------------------

Firmware::Firmware() : s_(std::make_unique<State>()) {
  MapArena();
  if (!gInstances.empty())
    SaveArena(*gInstances.back()->s_);
  gInstances.push_back(this);
  ClearArena();

  // The firmware's own regions, top-down as real firmware places them: the
  // tables in runtime data, a little runtime code, and boot services memory
  // of its own between them, so that the map has two separate runtime
  // regions among other types.
  State &s = *s_;
  UINT64 data = AllocateFirmwarePages(s, EfiRuntimeServicesData, kRuntimeDataPages, 0);
  AllocateFirmwarePages(s, EfiBootServicesCode, 16, 0xCC);
  AllocateFirmwarePages(s, EfiRuntimeServicesCode, kRuntimeCodePages, 0xCC);
  AllocateFirmwarePages(s, EfiBootServicesData, 32, 0);
  s.tables = new (reinterpret_cast<void *>(data)) RuntimeData();

  EFI_SYSTEM_TABLE &st = s.tables->system;
  std::memcpy(s.tables->vendor, kFirmwareVendor, sizeof(kFirmwareVendor));
  st.Hdr.Signature = EFI_SYSTEM_TABLE_SIGNATURE;
  st.Hdr.Revision = kSpecificationRevision;
  st.Hdr.HeaderSize = sizeof(EFI_SYSTEM_TABLE);
  st.FirmwareVendor = s.tables->vendor;
  st.FirmwareRevision = kFirmwareRevision;
  st.RuntimeServices = &s.tables->runtime;
  st.BootServices = &s.tables->boot;
  st.ConfigurationTable = s.tables->configuration;
  st.NumberOfTableEntries = 0;

  FillBootServices(s.tables->boot);
  s.tables->runtime.Hdr.Signature = EFI_RUNTIME_SERVICES_SIGNATURE;
  s.tables->runtime.Hdr.Revision = kSpecificationRevision;
  s.tables->runtime.Hdr.HeaderSize = sizeof(EFI_RUNTIME_SERVICES);
  InstallRuntimeServices(s.tables->runtime);
  UpdateTableCrc(&s.tables->runtime.Hdr, sizeof(EFI_RUNTIME_SERVICES));

  InitLoadedImage(s);
  InitConsoles(s);
  UpdateSystemTableCrc(s);
}

Firmware::~Firmware() {
  FreeAllPool(*s_);
  auto self = std::find(gInstances.begin(), gInstances.end(), this);
  bool active = self + 1 == gInstances.end();
  gInstances.erase(self);
  if (active) {
    ClearArena();
    if (!gInstances.empty()) {
      RestoreArena(*gInstances.back()->s_);
      if (gInstances.back()->s_->guarded)
        ApplyGuard(*gInstances.back()->s_);
    }
  }
}

Firmware *Firmware::Active() {
  return gInstances.empty() ? nullptr : gInstances.back();
}

EFI_SYSTEM_TABLE *Firmware::SystemTable() {
  return &s_->tables->system;
}
EFI_BOOT_SERVICES *Firmware::BootServices() {
  return &s_->tables->boot;
}
EFI_RUNTIME_SERVICES *Firmware::RuntimeServices() {
  return &s_->tables->runtime;
}
EFI_HANDLE Firmware::ImageHandle() {
  return s_->imageHandle;
}
EFI_LOADED_IMAGE_PROTOCOL *Firmware::LoadedImage() {
  return &s_->loadedImage;
}

// --- Runs -----------------------------------------------------------------------------

namespace {

// Runs `body` so that Exit, ResetSystem, the call gate or a halt come back
// here. The frame is on the heap and reached through a pointer that does not
// change after setjmp, so it is intact behind longjmp.
RunResult Guarded(State &s, const std::function<EFI_STATUS()> &body) {
  s.runs.push_back(std::make_unique<RunFrame>());
  RunFrame *frame = s.runs.back().get();
  if (setjmp(frame->jump) == 0) {
    EFI_STATUS status = body();
    frame->result.end = RunEnd::Returned;
    frame->result.status = status;
  }
  RunResult result = frame->result;
  s.runs.pop_back();
  return result;
}

}  // namespace

RunResult Firmware::Run(EFI_IMAGE_ENTRY_POINT entry) {
  EFI_HANDLE image = ImageHandle();
  EFI_SYSTEM_TABLE *systemTable = SystemTable();
  return Guarded(*s_, [&] { return entry(image, systemTable); });
}

RunResult Firmware::Call(const std::function<void()> &body) {
  return Guarded(*s_, [&] {
    body();
    return EFI_SUCCESS;
  });
}

// --- ExitBootServices, configuration tables, faults ---------------------------------------

bool Firmware::BootServicesExited() const {
  return s_->exited;
}
void Firmware::SetGateReturns(bool returns) {
  s_->gateReturns = returns;
}
const std::vector<std::string> &Firmware::ViolationsAfterExit() const {
  return s_->violations;
}

void Firmware::AddConfigurationTable(const EFI_GUID &guid, void *table) {
  EFI_SYSTEM_TABLE &st = s_->tables->system;
  if (st.NumberOfTableEntries == kMaxConfigurationTables)
    Misuse("too many configuration tables");
  s_->tables->configuration[st.NumberOfTableEntries++] = {guid, table};
  UpdateSystemTableCrc(*s_);
}

void Firmware::FailAllocation(unsigned nth, EFI_STATUS status) {
  if (nth == 0)
    Misuse("FailAllocation counts from 1");
  s_->faults.push_back({"", nth, status, false, {}});
}

void Firmware::FailCall(const std::string &name, unsigned nth, EFI_STATUS status, const EFI_GUID *protocol) {
  if (nth == 0 || name.empty())
    Misuse("FailCall needs a service name and counts from 1");
  s_->faults.push_back(
      {name, nth, status, protocol != nullptr, protocol != nullptr ? *protocol : EFI_GUID{}});
}

void Firmware::FailPoolAllocationOfSize(UINTN size, unsigned nth, EFI_STATUS status) {
  if (nth == 0)
    Misuse("FailPoolAllocationOfSize counts from 1");
  Fault fault{"AllocatePool", nth, status, false, {}};
  fault.hasSize = true;
  fault.size = size;
  s_->faults.push_back(fault);
}

const std::map<std::string, unsigned> &Firmware::CallCounts() const {
  return s_->callCounts;
}

unsigned Firmware::CallCount(const std::string &name) const {
  auto it = s_->callCounts.find(name);
  return it == s_->callCounts.end() ? 0 : it->second;
}

}  // namespace hostfw
