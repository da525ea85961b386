// The runtime services: NVRAM variables, the virtual address map, reset and
// the clock. They stay callable after ExitBootServices.
#include <cstdio>
#include <cstring>
#include <type_traits>
#include <ctime>

#include "hostfw/internal.h"

namespace hostfw {

namespace {

constexpr UINT32 kKnownAttributes =
    EFI_VARIABLE_NON_VOLATILE | EFI_VARIABLE_BOOTSERVICE_ACCESS | EFI_VARIABLE_RUNTIME_ACCESS;
constexpr INT16 kUnspecifiedTimeZone = 0x07FF;

Variable *Find(State &s, const std::u16string &name, const EFI_GUID &guid) {
  for (Variable &variable : s.variables) {
    if (variable.name == name && SameGuid(variable.guid, guid))
      return &variable;
  }
  return nullptr;
}

// After ExitBootServices only runtime variables are there.
bool Visible(const State &s, const Variable &variable) {
  return !s.exited || (variable.attributes & EFI_VARIABLE_RUNTIME_ACCESS) != 0;
}

EFI_STATUS EFIAPI GetVariable(const CHAR16 *VariableName, const EFI_GUID *VendorGuid, UINT32 *Attributes,
                              UINTN *DataSize, VOID *Data) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (RefusedAtRuntime(s, "GetVariable", &failure))
    return failure;
  if (VariableName == nullptr || VendorGuid == nullptr || DataSize == nullptr)
    return EFI_INVALID_PARAMETER;
  const Variable *variable = Find(s, VariableName, *VendorGuid);
  if (variable == nullptr || !Visible(s, *variable))
    return EFI_NOT_FOUND;
  if (Attributes != nullptr)
    *Attributes = variable->attributes;
  if (*DataSize < variable->data.size()) {
    *DataSize = variable->data.size();
    return EFI_BUFFER_TOO_SMALL;
  }
  if (Data == nullptr && !variable->data.empty())
    return EFI_INVALID_PARAMETER;
  if (!variable->data.empty())
    std::memcpy(Data, variable->data.data(), variable->data.size());
  *DataSize = variable->data.size();
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI GetNextVariableName(UINTN *VariableNameSize, CHAR16 *VariableName, EFI_GUID *VendorGuid) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (RefusedAtRuntime(s, "GetNextVariableName", &failure))
    return failure;
  if (VariableNameSize == nullptr || VariableName == nullptr || VendorGuid == nullptr)
    return EFI_INVALID_PARAMETER;
  // The name given must end within the size given.
  size_t length = 0;
  while (length * 2 < *VariableNameSize && VariableName[length] != 0)
    length++;
  if (length * 2 >= *VariableNameSize)
    return EFI_INVALID_PARAMETER;

  size_t next = 0;
  if (length != 0) {
    const Variable *current = Find(s, std::u16string(VariableName, length), *VendorGuid);
    if (current == nullptr || !Visible(s, *current))
      return EFI_INVALID_PARAMETER;
    next = size_t(current - s.variables.data()) + 1;
  }
  while (next < s.variables.size() && !Visible(s, s.variables[next]))
    next++;
  if (next == s.variables.size())
    return EFI_NOT_FOUND;

  const Variable &variable = s.variables[next];
  UINTN needed = (variable.name.size() + 1) * sizeof(CHAR16);
  if (*VariableNameSize < needed) {
    *VariableNameSize = needed;
    return EFI_BUFFER_TOO_SMALL;
  }
  std::memcpy(VariableName, variable.name.c_str(), needed);
  *VendorGuid = variable.guid;
  *VariableNameSize = needed;
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI SetVariable(const CHAR16 *VariableName, const EFI_GUID *VendorGuid, UINT32 Attributes,
                              UINTN DataSize, const VOID *Data) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (RefusedAtRuntime(s, "SetVariable", &failure))
    return failure;
  if (VariableName == nullptr || VariableName[0] == 0 || VendorGuid == nullptr)
    return EFI_INVALID_PARAMETER;
  if (DataSize != 0 && Data == nullptr)
    return EFI_INVALID_PARAMETER;
  if ((Attributes & ~kKnownAttributes) != 0)
    return EFI_INVALID_PARAMETER;
  // Runtime access needs boot service access too.
  if ((Attributes & EFI_VARIABLE_RUNTIME_ACCESS) != 0 &&
      (Attributes & EFI_VARIABLE_BOOTSERVICE_ACCESS) == 0) {
    return EFI_INVALID_PARAMETER;
  }
  if (s.exited && Attributes != 0 && (Attributes & EFI_VARIABLE_RUNTIME_ACCESS) == 0)
    return EFI_INVALID_PARAMETER;

  Variable *existing = Find(s, VariableName, *VendorGuid);
  if (existing != nullptr && !Visible(s, *existing))
    existing = nullptr;
  // A size or attributes of 0 deletes.
  if (DataSize == 0 || Attributes == 0) {
    if (existing == nullptr)
      return EFI_NOT_FOUND;
    s.variables.erase(s.variables.begin() + (existing - s.variables.data()));
    return EFI_SUCCESS;
  }
  if (existing != nullptr && existing->attributes != Attributes)
    return EFI_INVALID_PARAMETER;
  const auto *bytes = static_cast<const uint8_t *>(Data);
  if (existing != nullptr) {
    existing->data.assign(bytes, bytes + DataSize);
  } else {
    s.variables.push_back(
        {VariableName, *VendorGuid, Attributes, std::vector<uint8_t>(bytes, bytes + DataSize)});
  }
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI SetVirtualAddressMap(UINTN MemoryMapSize, UINTN DescriptorSize, UINT32 DescriptorVersion,
                                       EFI_MEMORY_DESCRIPTOR *VirtualMap) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (RefusedAtRuntime(s, "SetVirtualAddressMap", &failure))
    return failure;
  // Only once, and only after ExitBootServices.
  if (!s.exited || s.virtualMapSet)
    return EFI_UNSUPPORTED;
  if (DescriptorSize < sizeof(EFI_MEMORY_DESCRIPTOR) || DescriptorVersion != EFI_MEMORY_DESCRIPTOR_VERSION) {
    return EFI_INVALID_PARAMETER;
  }
  if (VirtualMap == nullptr && MemoryMapSize != 0)
    return EFI_INVALID_PARAMETER;
  const auto *bytes = reinterpret_cast<const uint8_t *>(VirtualMap);
  s.virtualMap.clear();
  for (UINTN offset = 0; offset + sizeof(EFI_MEMORY_DESCRIPTOR) <= MemoryMapSize; offset += DescriptorSize) {
    EFI_MEMORY_DESCRIPTOR descriptor;
    std::memcpy(&descriptor, bytes + offset, sizeof(descriptor));
    s.virtualMap.push_back(descriptor);
  }
  s.virtualMapSet = true;
  // As real firmware does, the system table's own pointers are converted to
  // the new addresses of the regions they point into, so that a copy of the
  // table made after this call is usable at its new place.
  EFI_SYSTEM_TABLE &st = s.tables->system;
  auto convert = [&s](auto *&pointer) {
    UINT64 address = reinterpret_cast<UINT64>(pointer);
    for (const EFI_MEMORY_DESCRIPTOR &d : s.virtualMap) {
      if ((d.Attribute & EFI_MEMORY_RUNTIME) && address >= d.PhysicalStart &&
          address - d.PhysicalStart < d.NumberOfPages * EFI_PAGE_SIZE) {
        pointer = reinterpret_cast<std::remove_reference_t<decltype(pointer)>>(address - d.PhysicalStart + d.VirtualStart);
        return;
      }
    }
  };
  convert(st.RuntimeServices);
  convert(st.ConfigurationTable);
  convert(st.FirmwareVendor);
  UpdateSystemTableCrc(s);
  return EFI_SUCCESS;
}

VOID EFIAPI ResetSystem(EFI_RESET_TYPE ResetType, EFI_STATUS ResetStatus, UINTN, const VOID *) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (RefusedAtRuntime(s, "ResetSystem", &failure))
    return;
  CurrentRun(s, "ResetSystem").result.resetType = ResetType;
  EndRun(s, RunEnd::Reset, ResetStatus);
}

EFI_TIME ToEfiTime(int64_t seconds) {
  std::time_t t = std::time_t(seconds);
  std::tm parts = {};
  gmtime_r(&t, &parts);
  EFI_TIME time = {};
  time.Year = UINT16(parts.tm_year + 1900);
  time.Month = UINT8(parts.tm_mon + 1);
  time.Day = UINT8(parts.tm_mday);
  time.Hour = UINT8(parts.tm_hour);
  time.Minute = UINT8(parts.tm_min);
  time.Second = UINT8(parts.tm_sec);
  time.TimeZone = kUnspecifiedTimeZone;
  return time;
}

EFI_STATUS EFIAPI GetTime(EFI_TIME *Time, VOID *) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (RefusedAtRuntime(s, "GetTime", &failure))
    return failure;
  if (Time == nullptr)
    return EFI_INVALID_PARAMETER;
  *Time = ToEfiTime(std::time(nullptr));
  return EFI_SUCCESS;
}

EFI_STATUS RuntimeUnprovided(const char *name) {
  State &s = Services::Active();
  EFI_STATUS failure;
  if (RefusedAtRuntime(s, name, &failure))
    return failure;
  std::fprintf(stderr, "hostfw: %s is not provided\n", name);
  return EFI_UNSUPPORTED;
}

#define HOSTFW_UNPROVIDED(Name)          \
  EFI_STATUS EFIAPI Unprovided##Name() { \
    return RuntimeUnprovided(#Name);     \
  }
HOSTFW_UNPROVIDED(SetTime)
HOSTFW_UNPROVIDED(GetWakeupTime)
HOSTFW_UNPROVIDED(SetWakeupTime)
HOSTFW_UNPROVIDED(ConvertPointer)
HOSTFW_UNPROVIDED(GetNextHighMonotonicCount)
HOSTFW_UNPROVIDED(UpdateCapsule)
HOSTFW_UNPROVIDED(QueryCapsuleCapabilities)
HOSTFW_UNPROVIDED(QueryVariableInfo)
#undef HOSTFW_UNPROVIDED

}  // namespace

EFI_TIME EfiTimeFromSeconds(int64_t seconds) {
  return ToEfiTime(seconds);
}

void InstallRuntimeServices(EFI_RUNTIME_SERVICES &rt) {
  rt.GetTime = reinterpret_cast<void *>(GetTime);
  rt.SetTime = reinterpret_cast<void *>(UnprovidedSetTime);
  rt.GetWakeupTime = reinterpret_cast<void *>(UnprovidedGetWakeupTime);
  rt.SetWakeupTime = reinterpret_cast<void *>(UnprovidedSetWakeupTime);
  rt.SetVirtualAddressMap = SetVirtualAddressMap;
  rt.ConvertPointer = reinterpret_cast<void *>(UnprovidedConvertPointer);
  rt.GetVariable = GetVariable;
  rt.GetNextVariableName = GetNextVariableName;
  rt.SetVariable = SetVariable;
  rt.GetNextHighMonotonicCount = reinterpret_cast<void *>(UnprovidedGetNextHighMonotonicCount);
  rt.ResetSystem = ResetSystem;
  rt.UpdateCapsule = reinterpret_cast<void *>(UnprovidedUpdateCapsule);
  rt.QueryCapsuleCapabilities = reinterpret_cast<void *>(UnprovidedQueryCapsuleCapabilities);
  rt.QueryVariableInfo = reinterpret_cast<void *>(UnprovidedQueryVariableInfo);
}

// --- The test's view --------------------------------------------------------------

void Firmware::PutVariable(const std::u16string &name, const EFI_GUID &guid, UINT32 attributes,
                           const std::vector<uint8_t> &data) {
  if (Variable *existing = Find(*s_, name, guid)) {
    existing->attributes = attributes;
    existing->data = data;
  } else {
    s_->variables.push_back({name, guid, attributes, data});
  }
}

const Variable *Firmware::FindVariable(const std::u16string &name, const EFI_GUID &guid) const {
  return Find(*s_, name, guid);
}

const std::vector<EFI_MEMORY_DESCRIPTOR> &Firmware::VirtualMap() const {
  return s_->virtualMap;
}
bool Firmware::VirtualMapSet() const {
  return s_->virtualMapSet;
}

}  // namespace hostfw
