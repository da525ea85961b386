#include "boot/handoff.h"

#include "boot/boot.h"
#include "boot/bootinfo.h"
#include "boot/stop.h"
#include "devicetree/devicetree.h"
#include "devicetree/platform.h"
#include "devicetree/volume_uuid.h"
#include "efi/vendor.h"
#include "memory/kernel_region.h"
#include "memory/runtime_map.h"
#include "memory/tracking.h"
#include "screen/bootscreen.h"
#include "screen/console.h"
#include "support/devicepath.h"
#include "support/strings.h"

namespace nimb {

static const char kFirmwareAbi[] = "EFI64";
static const char kAliasAcpi20[] = "ACPI_20";
static const char kAliasAcpi10[] = "ACPI";

// Offsets in the MAC address node and in the ACPI tables read here.
constexpr UINTN kMacAddressOffset = 4;
constexpr UINTN kMacInterfaceTypeOffset = 36;

// Bounds the device properties' size loop, which a firmware that keeps
// asking for the same size would never end.
constexpr int kDevicePropertiesTries = 8;

static DeviceTreeNode *Chosen(const char *failure) {
  DeviceTreeNode *chosen = DeviceTreeFindNode("/chosen", 1);
  if (chosen == nullptr) {
    Fatal(failure);
  }
  return chosen;
}

// The network card's MAC address as a matching text the kernel finds its
// root device by, and the mark of a network boot.
static void AddNetworkIdentity() {
  const UINT8 *mac = reinterpret_cast<const UINT8 *>(
      DevicePathFindNode(gBootDevicePath, kMaxDevicePathSize, MESSAGING_DEVICE_PATH, MSG_MAC_ADDR_DP));
  if (mac == nullptr || DevicePathNodeLength(reinterpret_cast<const EFI_DEVICE_PATH_PROTOCOL *>(mac)) <=
                            kMacInterfaceTypeOffset) {
    return;
  }
  char *text =
      static_cast<char *>(TrackedAllocatePool(strlen(kRootMatchingHead) + strlen(kRootMatchingTail) + 80));
  if (text == nullptr) {
    return;
  }
  strcpy(text, kRootMatchingHead);
  char *write = text + strlen(text);
  UINTN digits = mac[kMacInterfaceTypeOffset] < 2 ? 6 : 32;
  for (UINTN i = 0; i < digits; i++) {
    sprintf(write, "%02x", mac[kMacAddressOffset + i]);
    write += 2;
  }
  strcpy(write, kRootMatchingTail);

  DeviceTreeAddProperty(Chosen("Could not create chosen node\n"), "root-matching", strlen(text) + 1, text, 0);
  DeviceTreeNode *root = DeviceTreeFindNode("/", 1);
  if (root == nullptr) {
    Fatal("Could not get root node\n");
  }
  DeviceTreeAddProperty(root, "net-boot", 0, nullptr, 0);
}

typedef EFI_STATUS(EFIAPI *NetBootAnswer)(NIMB_NET_BOOT_INFO_PROTOCOL *This, UINTN *BufferSize, VOID *Buffer);

// One answer of the boot servers as a property of /chosen; false when there
// is none.
static bool AddNetworkAnswer(NIMB_NET_BOOT_INFO_PROTOCOL *info, NetBootAnswer ask, DeviceTreeNode *chosen,
                             const char *name) {
  UINTN size = 0;
  if (ask(info, &size, nullptr) != EFI_BUFFER_TOO_SMALL) {
    return false;
  }
  void *buffer = TrackedAllocatePool(size);
  if (buffer == nullptr) {
    return false;
  }
  if (EFI_ERROR(ask(info, &size, buffer))) {
    TrackedFree(buffer);
    return false;
  }
  // The tree refers to the buffer: it is not freed.
  DeviceTreeAddProperty(chosen, name, size, buffer, 0);
  return true;
}

static void AddNetworkAnswers() {
  NIMB_NET_BOOT_INFO_PROTOCOL *info = nullptr;
  if (EFI_ERROR(gBS->HandleProtocol(gLoadedImage->DeviceHandle, &gNimbNetBootInfoProtocolGuid,
                                    reinterpret_cast<void **>(&info))) &&
      EFI_ERROR(
          gBS->LocateProtocol(&gNimbNetBootInfoProtocolGuid, nullptr, reinterpret_cast<void **>(&info)))) {
    return;
  }
  if (info == nullptr) {
    return;
  }
  DeviceTreeNode *chosen = Chosen("Could not create chosen node\n");
  if (AddNetworkAnswer(info, info->GetDhcpResponse, chosen, "dhcp-response")) {
    AddNetworkAnswer(info, info->GetBsdpResponse, chosen, "svcd-response");
  }
}

// One child of /efi/configuration-table for each of the firmware's tables.
static void AddConfigurationTables() {
  DeviceTreeNode *tables = DeviceTreeFindNode("/efi/configuration-table", 1);
  if (tables == nullptr) {
    Fatal("Could not create /efi/configuration-table node");
  }
  for (UINTN i = 0; i < gST->NumberOfTableEntries; i++) {
    EFI_CONFIGURATION_TABLE *entry = &gST->ConfigurationTable[i];
    char name[kUuidTextSize];
    FormatGuid(&entry->VendorGuid, name);
    DeviceTreeNode *child = DeviceTreeAddChild(tables, name);
    if (child == nullptr) {
      Fatal("Couldn't add table child node\n");
    }
    DeviceTreeAddProperty(child, "guid", sizeof(EFI_GUID), &entry->VendorGuid, 0);
    DeviceTreeAddProperty(child, "table", sizeof(entry->VendorTable), &entry->VendorTable, 0);
    if (CompareGuid(&entry->VendorGuid, &gEfiAcpi20TableGuid)) {
      DeviceTreeAddProperty(child, "alias", sizeof(kAliasAcpi20), kAliasAcpi20, 0);
    } else if (CompareGuid(&entry->VendorGuid, &gEfiAcpi10TableGuid)) {
      DeviceTreeAddProperty(child, "alias", sizeof(kAliasAcpi10), kAliasAcpi10, 0);
    }
  }
}

static void AddDeviceProperties(DeviceTreeNode *efi) {
  NIMB_DEVICE_PROPERTIES_PROTOCOL *properties = nullptr;
  if (EFI_ERROR(gBS->LocateProtocol(&gNimbDevicePropertiesProtocolGuid, nullptr,
                                    reinterpret_cast<void **>(&properties))) ||
      properties == nullptr) {
    return;
  }
  UINT32 size = 4096;
  UINT32 asked = size;
  void *buffer = nullptr;
  EFI_STATUS status = EFI_BUFFER_TOO_SMALL;
  for (int tries = 0; tries < kDevicePropertiesTries && status == EFI_BUFFER_TOO_SMALL; tries++) {
    if (buffer != nullptr) {
      TrackedFree(buffer);
    }
    asked = size;
    buffer = TrackedAllocatePool(size);
    if (buffer == nullptr) {
      Fatal("Could not allocate property buffer\n");
    }
    status = properties->GetProperties(properties, buffer, &size);
  }
  // A buffer the firmware could not fill holds nothing the kernel can use;
  // what it did fill is never taken for more than the buffer.
  if (status != EFI_BUFFER_TOO_SMALL) {
    size = size < asked ? size : asked;
    DeviceTreeAddProperty(efi, "device-properties", size, buffer, 1);
  }
  TrackedFree(buffer);
}

static void AddFirmwareFacts() {
  DeviceTreeNode *runtime = DeviceTreeFindNode("/efi/runtime-services", 1);
  if (runtime == nullptr) {
    Fatal("Could not create /efi/runtime-services node");
  }
  DeviceTreeAddProperty(runtime, "table", sizeof(gST->RuntimeServices), &gST->RuntimeServices, 0);

  DeviceTreeNode *efi = DeviceTreeFindNode("/efi", 0);
  if (efi == nullptr) {
    Fatal("Could not create /efi/runtime-services node");
  }
  const CHAR16 *vendor = gST->FirmwareVendor != nullptr ? gST->FirmwareVendor : u"";
  DeviceTreeAddProperty(efi, "firmware-vendor", 2 * StrLen(vendor) + 2, vendor, 0);
  DeviceTreeAddProperty(efi, "firmware-revision", sizeof(gST->FirmwareRevision), &gST->FirmwareRevision, 0);
  DeviceTreeAddProperty(efi, "firmware-abi", sizeof(kFirmwareAbi), kFirmwareAbi, 0);
  AddDeviceProperties(efi);
}

static void AddCommandLine(const char *options) {
  strncpy(bootArgs->commandLine, options, sizeof(bootArgs->commandLine));
  bootArgs->commandLine[sizeof(bootArgs->commandLine) - 1] = 0;
  DeviceTreeNode *chosen = Chosen("no /chosen found");
  DeviceTreeAddProperty(chosen, "boot-args", strlen(bootArgs->commandLine) + 1, bootArgs->commandLine, 0);
}

// The hardware signature of the firmware's ACPI control structure, which
// changes when the machine's hardware does.
static void AddMachineSignature() {
  const UINT8 *facs = FindFacs();
  if (facs == nullptr) {
    return;
  }
  const UINT32 signature = FacsHardwareSignature(facs);
  DeviceTreeAddProperty(Chosen("no /chosen found"), "machine-signature", 4, &signature, 1);
}

// The tree, flattened at the top of the kernel region. Nothing may be added
// to it from here on.
static void FlattenTree() {
  UINT64 size = 0;
  DeviceTreeFlatten(nullptr, &size);
  UINT64 address = gKernelRegionTop;
  UINT64 pageSize = size;
  if (AllocateKernelPages(&address, &pageSize) == 0) {
    Fatal("Couldn't allocate device tree\n");
  }
  gKernelRegionTop += pageSize;
  DeviceTreeFlatten(&address, &size);
  bootArgs->deviceTree = static_cast<UINT32>(address);
  bootArgs->deviceTreeLength = static_cast<UINT32>(size);
  DeviceTreeFree();
}

struct MapShape {
  UINTN descriptorSize;
  UINT32 descriptorVersion;
};

// The size the memory map needs now.
static UINTN ProbeMemoryMap(UINTN *mapKey, MapShape *shape) {
  UINTN probeSize = 0;
  EFI_STATUS status =
      gBS->GetMemoryMap(&probeSize, nullptr, mapKey, &shape->descriptorSize, &shape->descriptorVersion);
  if (status != EFI_BUFFER_TOO_SMALL) {
    Fatal("Couldn't get memory map size (%x)\n", status);
  }
  return probeSize;
}

// A stride smaller than a descriptor cannot be walked.
static void CheckStride(const MapShape &shape, const char *format) {
  if (shape.descriptorSize < sizeof(EFI_MEMORY_DESCRIPTOR)) {
    Fatal(format, EFI_INVALID_PARAMETER);
  }
}

// The runtime code and data regions of a map read into `map`, each of which
// the runtime move adds a descriptor for.
static UINTN CountRuntimeRegionsIn(const UINT8 *map, UINTN mapSize, UINTN descriptorSize) {
  UINTN count = 0;
  for (UINTN offset = 0; offset + descriptorSize <= mapSize; offset += descriptorSize) {
    const EFI_MEMORY_DESCRIPTOR *descriptor = reinterpret_cast<const EFI_MEMORY_DESCRIPTOR *>(map + offset);
    if (descriptor->Type == EfiRuntimeServicesCode || descriptor->Type == EfiRuntimeServicesData) {
      count++;
    }
  }
  return count;
}

// Reads the map into pool once, only to count its runtime regions, which
// the runtime move adds a descriptor for each.
static UINTN CountRuntimeRegions(UINTN *mapKey, MapShape *shape, UINTN *mapBytes) {
  UINT8 *buffer = nullptr;
  UINTN capacity = 0;
  UINTN bufferSize = 0;
  for (int tries = kMemoryMapTries;; tries--) {
    UINTN probeSize = ProbeMemoryMap(mapKey, shape);
    if (probeSize > capacity) {
      capacity = probeSize + kMemoryMapMargin;
      if (buffer != nullptr) {
        TrackedFree(buffer);
      }
      buffer = static_cast<UINT8 *>(TrackedAllocatePool(capacity));
      if (buffer == nullptr) {
        Fatal("Can't get current memory map (3)\n");
      }
    }
    bufferSize = capacity;
    EFI_STATUS status = gBS->GetMemoryMap(&bufferSize, reinterpret_cast<EFI_MEMORY_DESCRIPTOR *>(buffer),
                                          mapKey, &shape->descriptorSize, &shape->descriptorVersion);
    if (!EFI_ERROR(status)) {
      break;
    }
    if (tries - 1 == 0) {
      Fatal("Can't get current memory map (4, %lx)\n", status);
    }
  }
  CheckStride(*shape, "Can't get current memory map (4, %lx)\n");
  UINTN runtimeCount = CountRuntimeRegionsIn(buffer, bufferSize, shape->descriptorSize);
  TrackedFree(buffer);
  *mapBytes = bufferSize;
  return runtimeCount;
}

EFI_STATUS FinishBootInfo(UINTN *mapKey, const char *options) {
  if (options == nullptr) {
    options = "";
  }
  AddNetworkIdentity();
  AddNetworkAnswers();
  AddConfigurationTables();
  AddFirmwareFacts();
  FillVideoInfo(bootArgs);
  AddCommandLine(options);
  AddMachineSignature();
  FlattenTree();

  // The memory map goes into the kernel region, with room for one more
  // descriptor per runtime region and a margin for what the firmware
  // allocates between the reads.
  MapShape shape = {0, 0};
  UINTN mapBytes = 0;
  UINTN runtimeCount = CountRuntimeRegions(mapKey, &shape, &mapBytes);
  UINT64 bufferSize = runtimeCount * shape.descriptorSize + mapBytes + kMemoryMapMargin;
  UINT8 *map = reinterpret_cast<UINT8 *>(AllocateKernelRegion(&bufferSize));
  if (map == nullptr) {
    Fatal("Couldn't allocate memory map\n");
  }
  // The firmware may fill the buffer only up to the room that the runtime
  // descriptors of the move need behind the map; a read that finds more
  // runtime regions than that room holds is made again.
  UINTN mapSize = 0;
  for (int tries = kMemoryMapTries;; tries--) {
    UINTN probeSize = ProbeMemoryMap(mapKey, &shape);
    UINT64 room = runtimeCount * shape.descriptorSize;
    if (probeSize + room > bufferSize) {
      // The new pages lie right behind the map's last page: it grows in place.
      UINT64 more = probeSize + room - bufferSize + kMemoryMapMargin;
      if (AllocateKernelRegion(&more) == 0) {
        Fatal("Couldn't allocate memory map (2)\n");
      }
      bufferSize += more;
    }
    mapSize = static_cast<UINTN>(bufferSize - room);
    EFI_STATUS status = gBS->GetMemoryMap(&mapSize, reinterpret_cast<EFI_MEMORY_DESCRIPTOR *>(map), mapKey,
                                          &shape.descriptorSize, &shape.descriptorVersion);
    if (!EFI_ERROR(status)) {
      CheckStride(shape, "Can't get current memory map (5, %lx)\n");
      UINTN count = CountRuntimeRegionsIn(map, mapSize, shape.descriptorSize);
      bool fits = mapSize + count * shape.descriptorSize <= bufferSize;
      runtimeCount = count;
      if (fits) {
        break;
      }
      status = EFI_BUFFER_TOO_SMALL;
    }
    if (tries - 1 == 0) {
      Fatal("Can't get current memory map (5, %lx)\n", status);
    }
  }
  EFI_MEMORY_DESCRIPTOR *mapStart = reinterpret_cast<EFI_MEMORY_DESCRIPTOR *>(map);
  EFI_MEMORY_DESCRIPTOR *mapEnd = reinterpret_cast<EFI_MEMORY_DESCRIPTOR *>(map + mapSize);
  UINT64 runtimeStart = (gKernelRegionTop + EFI_PAGE_SIZE - 1) & ~(EFI_PAGE_SIZE - 1);
  UINT64 nextVirtual = runtimeStart;
  // The runtime move writes above the kernel region, where nothing was
  // allocated: the whole area has to be free while a message can still say so.
  if (!RuntimeAreaIsFree(mapStart, mapEnd, shape.descriptorSize, runtimeStart,
                         kRuntimeSparePages * EFI_PAGE_SIZE)) {
    Fatal("Runtime services area not free\n");
  }
  // From here to ExitBootServices nothing allocates or frees: the key holds.
  bootArgs->memoryMap = static_cast<UINT32>(reinterpret_cast<UINT64>(map));
  bootArgs->memoryMapSize = static_cast<UINT32>(mapSize + runtimeCount * shape.descriptorSize);
  bootArgs->memoryDescriptorSize = static_cast<UINT32>(shape.descriptorSize);
  bootArgs->memoryDescriptorVersion = shape.descriptorVersion;

  if (EFI_ERROR(gBS->ExitBootServices(gImageHandle, *mapKey))) {
    Fatal("Error exiting boot services\n");
  }

  // Boot services are gone: no console, no pool, no Fatal from here on.
  MapRuntimeServices(mapStart, mapEnd, &mapEnd, shape.descriptorSize, shape.descriptorVersion, &nextVirtual,
                     FALSE);
  bootArgs->systemTable = static_cast<UINT32>(reinterpret_cast<UINT64>(gST));
  gBS = nullptr;
  gRT = nullptr;
  if (bootArgs->systemTable == 0) {
    StopAfterBootServices("Error finding runtimeServicesVirtual\n", FALSE);
  }

  nextVirtual += kRuntimeSparePages * EFI_PAGE_SIZE;
  gKernelRegionTop = nextVirtual;
  bootArgs->runtimePageStart = static_cast<UINT32>(runtimeStart / EFI_PAGE_SIZE);
  bootArgs->runtimePageCount = static_cast<UINT32>((nextVirtual - runtimeStart) / EFI_PAGE_SIZE);
  bootArgs->kernelRegionBase = static_cast<UINT32>(gKernelRegionBase);
  bootArgs->kernelRegionSize = static_cast<UINT32>(gKernelRegionTop - gKernelRegionBase);
  return EFI_SUCCESS;
}

}  // namespace nimb
