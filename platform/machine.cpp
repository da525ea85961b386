#include "machine.h"

#include "firmware.h"
#include "support/strings.h"

namespace nimb::platform {

namespace {

const EFI_GUID kSmbiosTableGuid = {
    0xEB9D2D31, 0x2D88, 0x11D3, {0x9A, 0x16, 0x00, 0x90, 0x27, 0x3F, 0xC1, 0x4D}};
const EFI_GUID kSmbios3TableGuid = {
    0xF2FD1544, 0x9794, 0x4A2C, {0x99, 0x2E, 0xE5, 0xBB, 0xCF, 0x20, 0xE3, 0x94}};

constexpr UINT8 kSystemInformation = 1;
constexpr UINT8 kEndOfTable = 127;
constexpr UINTN kManufacturerField = 4;  // the string number in a type 1 structure

UINT32 Read32(const UINT8 *p) {
  return p[0] | (p[1] << 8) | (p[2] << 16) | (static_cast<UINT32>(p[3]) << 24);
}

void *ConfigurationTable(const EFI_GUID &guid) {
  for (UINTN i = 0; i < gST->NumberOfTableEntries; i++) {
    if (CompareGuid(&gST->ConfigurationTable[i].VendorGuid, &guid)) {
      return gST->ConfigurationTable[i].VendorTable;
    }
  }
  return nullptr;
}

}  // namespace

bool SmbiosManufacturerIs(const UINT8 *table, UINTN size, const char *name) {
  UINTN at = 0;
  while (at + 4 <= size) {
    const UINT8 type = table[at];
    const UINTN length = table[at + 1];
    if (length < 4 || at + length > size) {
      return false;
    }
    // The strings behind the formatted area, each with its NUL, end in a
    // second NUL (two NULs when there are none).
    const UINTN strings = at + length;
    UINTN end = strings;
    while (end + 1 < size && (table[end] != 0 || table[end + 1] != 0)) {
      end++;
    }
    if (end + 1 >= size) {
      return false;
    }
    if (type == kSystemInformation) {
      UINTN number = length > kManufacturerField ? table[at + kManufacturerField] : 0;
      for (UINTN p = strings; number != 0 && p < end;
           p += strlen(reinterpret_cast<const char *>(table + p)) + 1) {
        if (--number == 0) {
          return strcmp(reinterpret_cast<const char *>(table + p), name) == 0;
        }
      }
      return false;
    }
    if (type == kEndOfTable) {
      return false;
    }
    at = end + 2;
  }
  return false;
}

bool MachineIsQemu() {
  const UINT8 *entry = static_cast<const UINT8 *>(ConfigurationTable(kSmbios3TableGuid));
  if (entry != nullptr && strncmp(reinterpret_cast<const char *>(entry), "_SM3_", 5) == 0) {
    const UINT64 address = Read32(entry + 0x10) | (static_cast<UINT64>(Read32(entry + 0x14)) << 32);
    return SmbiosManufacturerIs(reinterpret_cast<const UINT8 *>(address), Read32(entry + 0x0C), "QEMU");
  }
  entry = static_cast<const UINT8 *>(ConfigurationTable(kSmbiosTableGuid));
  if (entry != nullptr && strncmp(reinterpret_cast<const char *>(entry), "_SM_", 4) == 0) {
    const UINTN length = entry[0x16] | (entry[0x17] << 8);
    return SmbiosManufacturerIs(reinterpret_cast<const UINT8 *>(static_cast<UINTN>(Read32(entry + 0x18))),
                                length, "QEMU");
  }
  return false;
}

}  // namespace nimb::platform
