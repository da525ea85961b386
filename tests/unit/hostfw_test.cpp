// The host firmware that every other test stands on: memory, the memory map,
// fault injection, directory volumes, NVRAM, the ways a run ends, and what
// happens after ExitBootServices.
#include "hostfw/hostfw.h"

#include <gtest/gtest.h>

#include <cstring>
#include <filesystem>
#include <functional>
#include <string>
#include <utility>
#include <vector>

#include "boot/machine.h"
#include "temp_dir.h"

namespace {

namespace fs = std::filesystem;
using hostfw::Firmware;
using hostfw::RunEnd;
using hostfw::RunResult;

const EFI_GUID kVendor = EFI_GUID_VALUE(0x12345678, 0x1234, 0x5678, 1, 2, 3, 4, 5, 6, 7, 8);

std::vector<EFI_MEMORY_DESCRIPTOR> ReadMap(Firmware &fw, UINTN *key = nullptr) {
  UINTN size = 0, mapKey = 0, descriptorSize = 0;
  UINT32 version = 0;
  EXPECT_EQ(fw.BootServices()->GetMemoryMap(&size, nullptr, &mapKey, &descriptorSize, &version),
            EFI_BUFFER_TOO_SMALL);
  EXPECT_EQ(descriptorSize, hostfw::kDescriptorSize);
  EXPECT_EQ(version, EFI_MEMORY_DESCRIPTOR_VERSION);
  std::vector<uint8_t> buffer(size);
  EXPECT_EQ(fw.BootServices()->GetMemoryMap(&size, reinterpret_cast<EFI_MEMORY_DESCRIPTOR *>(buffer.data()),
                                            &mapKey, &descriptorSize, &version),
            EFI_SUCCESS);
  std::vector<EFI_MEMORY_DESCRIPTOR> map(size / descriptorSize);
  for (size_t i = 0; i < map.size(); i++)
    std::memcpy(&map[i], &buffer[i * descriptorSize], sizeof(map[i]));
  if (key != nullptr)
    *key = mapKey;
  return map;
}

const EFI_MEMORY_DESCRIPTOR *Containing(const std::vector<EFI_MEMORY_DESCRIPTOR> &map, const void *pointer) {
  UINT64 address = reinterpret_cast<UINT64>(pointer);
  for (const EFI_MEMORY_DESCRIPTOR &d : map) {
    if (d.PhysicalStart <= address && address < d.PhysicalStart + d.NumberOfPages * EFI_PAGE_SIZE)
      return &d;
  }
  return nullptr;
}

// --- Memory ---------------------------------------------------------------------------------

TEST(HostfwMemory, AllocateAddressGivesWritableJunkFilledPagesThere) {
  Firmware fw;
  EFI_BOOT_SERVICES *bs = fw.BootServices();
  EFI_PHYSICAL_ADDRESS address = 0x200000;
  ASSERT_EQ(bs->AllocatePages(AllocateAddress, EfiLoaderData, 3, &address), EFI_SUCCESS);
  EXPECT_EQ(address, 0x200000u);
  auto *bytes = reinterpret_cast<uint8_t *>(address);
  EXPECT_EQ(bytes[0], 0xAF);
  EXPECT_EQ(bytes[3 * EFI_PAGE_SIZE - 1], 0xAF);
  EXPECT_EQ(fw.AllocatedPages(), 3u);

  struct Row {
    const char *name;
    EFI_ALLOCATE_TYPE type;
    UINT32 memoryType;
    UINTN pages;
    EFI_PHYSICAL_ADDRESS request;
    EFI_STATUS expected;
  };
  const Row rows[] = {
      {"overlaps the allocation", AllocateAddress, EfiLoaderData, 1, 0x202000, EFI_NOT_FOUND},
      {"runs into the allocation", AllocateAddress, EfiLoaderData, 2, 0x1FF000, EFI_NOT_FOUND},
      {"below the arena", AllocateAddress, EfiLoaderData, 1, 0x1000, EFI_NOT_FOUND},
      {"past the arena", AllocateAddress, EfiLoaderData, 2, hostfw::kArenaLimit - EFI_PAGE_SIZE,
       EFI_NOT_FOUND},
      {"not page aligned", AllocateAddress, EfiLoaderData, 1, 0x300800, EFI_NOT_FOUND},
      {"no pages at an address", AllocateAddress, EfiLoaderData, 0, 0x300000, EFI_NOT_FOUND},
      {"more than there is", AllocateAnyPages, EfiLoaderData, 0x40000, 0, EFI_OUT_OF_RESOURCES},
      {"bad allocation type", MaxAllocateType, EfiLoaderData, 1, 0, EFI_INVALID_PARAMETER},
      {"free memory as type", AllocateAnyPages, EfiConventionalMemory, 1, 0, EFI_INVALID_PARAMETER},
      {"type past the standard ones", AllocateAnyPages, EfiMaxMemoryType, 1, 0, EFI_INVALID_PARAMETER},
  };
  for (const Row &row : rows) {
    EFI_PHYSICAL_ADDRESS request = row.request;
    EXPECT_EQ(bs->AllocatePages(row.type, EFI_MEMORY_TYPE(row.memoryType), row.pages, &request), row.expected)
        << row.name;
    EXPECT_EQ(request, row.request) << row.name;
  }
  EXPECT_EQ(bs->AllocatePages(AllocateAnyPages, EfiLoaderData, 1, nullptr), EFI_INVALID_PARAMETER);

  // Frees must match what was allocated.
  EXPECT_EQ(bs->FreePages(0x200000, 2), EFI_NOT_FOUND);
  EXPECT_EQ(bs->FreePages(0x200800, 3), EFI_INVALID_PARAMETER);
  EXPECT_EQ(bs->FreePages(0x200000, 3), EFI_SUCCESS);
  EXPECT_EQ(bs->FreePages(0x200000, 3), EFI_NOT_FOUND);
  EXPECT_EQ(fw.AllocatedPages(), 0u);
}

TEST(HostfwMemory, AllocateMaxAddressTakesTheHighestPagesUnderTheLimit) {
  Firmware fw;
  EFI_BOOT_SERVICES *bs = fw.BootServices();
  EFI_PHYSICAL_ADDRESS top = 0;
  ASSERT_EQ(bs->AllocatePages(AllocateAnyPages, EfiLoaderData, 1, &top), EFI_SUCCESS);
  // Any pages come from the top, just below the firmware's own regions.
  EXPECT_GT(top, hostfw::kArenaLimit - 0x100000);

  struct Row {
    UINT64 limit;
    UINTN pages;
    UINT64 expectedEnd;  // one past the last byte given
  };
  const Row rows[] = {
      {0xFFFFFFFF, 1, top},         // above the arena: like any pages
      {0x20000FFF, 2, 0x20001000},  // the last byte is the limit itself
      {0x10000FFE, 2, 0x10000000},  // one byte short of a page: the page below
  };
  for (const Row &row : rows) {
    EFI_PHYSICAL_ADDRESS address = row.limit;
    ASSERT_EQ(bs->AllocatePages(AllocateMaxAddress, EfiLoaderCode, row.pages, &address), EFI_SUCCESS)
        << row.limit;
    EXPECT_LE(address + row.pages * EFI_PAGE_SIZE - 1, row.limit);
    EXPECT_EQ(address + row.pages * EFI_PAGE_SIZE, row.expectedEnd) << std::hex << row.limit;
  }
  EFI_PHYSICAL_ADDRESS tooLow = hostfw::kArenaBase;
  EXPECT_EQ(bs->AllocatePages(AllocateMaxAddress, EfiLoaderData, 1, &tooLow), EFI_OUT_OF_RESOURCES);
}

TEST(HostfwMemory, PoolIsJunkFilledCountedAndRefusesUnknownPointers) {
  Firmware fw;
  EFI_BOOT_SERVICES *bs = fw.BootServices();
  void *block = nullptr;
  ASSERT_EQ(bs->AllocatePool(EfiBootServicesData, 16, &block), EFI_SUCCESS);
  EXPECT_EQ(static_cast<uint8_t *>(block)[15], 0xAF);
  EXPECT_EQ(fw.LivePoolBlocks(), 1u);
  int local = 0;
  EXPECT_EQ(bs->FreePool(&local), EFI_INVALID_PARAMETER);
  EXPECT_EQ(bs->FreePool(nullptr), EFI_INVALID_PARAMETER);
  EXPECT_EQ(bs->AllocatePool(EfiConventionalMemory, 16, &block), EFI_INVALID_PARAMETER);
  EXPECT_EQ(bs->FreePool(block), EFI_SUCCESS);
  EXPECT_EQ(bs->FreePool(block), EFI_INVALID_PARAMETER);
  EXPECT_EQ(fw.LivePoolBlocks(), 0u);
  EXPECT_EQ(fw.FreePoolCalls(), 4u);
}

// --- The memory map ---------------------------------------------------------------------------

TEST(HostfwMemoryMap, SortedContiguousOverTheArenaWithTheTablesInRuntimeData) {
  Firmware fw;
  fw.AddMemoryRegion(EfiMemoryMappedIO, 0xFEC00000, 1, EFI_MEMORY_UC | EFI_MEMORY_RUNTIME);
  fw.AddMemoryRegion(EfiACPIReclaimMemory, 0x800000, 4, EFI_MEMORY_WB);
  EFI_PHYSICAL_ADDRESS address = 0x400000;
  ASSERT_EQ(fw.BootServices()->AllocatePages(AllocateAddress, EfiLoaderCode, 2, &address), EFI_SUCCESS);

  std::vector<EFI_MEMORY_DESCRIPTOR> map = ReadMap(fw);
  EXPECT_EQ(map.size(), fw.MemoryMap().size());
  ASSERT_FALSE(map.empty());
  EXPECT_EQ(map.front().PhysicalStart, hostfw::kArenaBase);
  UINT64 arenaEnd = 0;
  for (size_t i = 0; i < map.size(); i++) {
    const EFI_MEMORY_DESCRIPTOR &d = map[i];
    EXPECT_GT(d.NumberOfPages, 0u);
    UINT64 end = d.PhysicalStart + d.NumberOfPages * EFI_PAGE_SIZE;
    // Sorted, and inside the arena nothing is left out.
    if (i + 1 < map.size())
      EXPECT_TRUE(end < hostfw::kArenaLimit ? end == map[i + 1].PhysicalStart
                                            : end <= map[i + 1].PhysicalStart)
          << "descriptor " << i;
    if (end == hostfw::kArenaLimit)
      arenaEnd = end;
    if (d.Type == EfiRuntimeServicesCode || d.Type == EfiRuntimeServicesData)
      EXPECT_TRUE(d.Attribute & EFI_MEMORY_RUNTIME) << i;
  }
  EXPECT_EQ(arenaEnd, hostfw::kArenaLimit);

  struct Row {
    const char *name;
    const void *pointer;
    UINT32 type;
  };
  EFI_SYSTEM_TABLE *st = fw.SystemTable();
  const Row rows[] = {
      {"system table", st, EfiRuntimeServicesData},
      {"runtime services", st->RuntimeServices, EfiRuntimeServicesData},
      {"configuration table", st->ConfigurationTable, EfiRuntimeServicesData},
      {"loader pages", reinterpret_cast<void *>(0x400000), EfiLoaderCode},
      {"declared ACPI", reinterpret_cast<void *>(0x803000), EfiACPIReclaimMemory},
      {"declared MMIO", reinterpret_cast<void *>(0xFEC00000), EfiMemoryMappedIO},
  };
  for (const Row &row : rows) {
    const EFI_MEMORY_DESCRIPTOR *d = Containing(map, row.pointer);
    ASSERT_NE(d, nullptr) << row.name;
    EXPECT_EQ(d->Type, row.type) << row.name;
  }
}

TEST(HostfwMemoryMap, KeyChangesWithTheMapAndGrowthShowsOnTheNextCall) {
  Firmware fw;
  EFI_BOOT_SERVICES *bs = fw.BootServices();
  UINTN key = 0;
  std::vector<EFI_MEMORY_DESCRIPTOR> before = ReadMap(fw, &key);
  EXPECT_EQ(key, fw.MapKey());

  UINTN old = key;
  auto changed = [&] { return std::exchange(old, fw.MapKey()) != fw.MapKey(); };
  void *block = nullptr;
  EFI_PHYSICAL_ADDRESS pages = 0;
  bs->AllocatePool(EfiLoaderData, 8, &block);
  EXPECT_TRUE(changed()) << "pool allocation";
  bs->FreePool(block);
  EXPECT_TRUE(changed()) << "pool free";
  bs->AllocatePages(AllocateAnyPages, EfiLoaderData, 1, &pages);
  EXPECT_TRUE(changed()) << "page allocation";
  bs->FreePages(pages, 1);
  EXPECT_TRUE(changed()) << "page free";
  fw.AddMemoryRegion(EfiReservedMemoryType, 0x600000, 1, 0);
  EXPECT_TRUE(changed()) << "declared region";

  // A buffer sized by the last read is too small once the firmware has
  // allocated behind the caller's back.
  before = ReadMap(fw, &key);
  fw.GrowMemoryMapOnNextCall(3);
  std::vector<uint8_t> buffer(before.size() * hostfw::kDescriptorSize);
  UINTN size = buffer.size(), descriptorSize = 0;
  UINT32 version = 0;
  UINTN newKey = key;
  EXPECT_EQ(bs->GetMemoryMap(&size, reinterpret_cast<EFI_MEMORY_DESCRIPTOR *>(buffer.data()), &newKey,
                             &descriptorSize, &version),
            EFI_BUFFER_TOO_SMALL);
  EXPECT_EQ(size, (before.size() + 3) * hostfw::kDescriptorSize);
  EXPECT_NE(fw.MapKey(), key);
  EXPECT_EQ(ReadMap(fw).size(), before.size() + 3);
  EXPECT_EQ(fw.AllocatedPages(), 0u);

  // ExitBootServices wants the current key.
  EXPECT_EQ(bs->ExitBootServices(fw.ImageHandle(), key), EFI_INVALID_PARAMETER);
  EXPECT_FALSE(fw.BootServicesExited());
  EXPECT_EQ(bs->ExitBootServices(fw.ImageHandle(), fw.MapKey()), EFI_SUCCESS);
  EXPECT_TRUE(fw.BootServicesExited());
}

// --- Fault injection ------------------------------------------------------------------------

TEST(HostfwFaults, FailByCountByNameAndByProtocolWithoutSideEffects) {
  struct Row {
    const char *name;
    std::function<void(Firmware &)> arm;
    std::vector<EFI_STATUS> expected;  // pool, pages, pool, pages, LoadedImage, DevicePath, LoadedImage
  };
  const EFI_STATUS ok = EFI_SUCCESS, unsupported = EFI_UNSUPPORTED;
  const Row rows[] = {
      {"nothing armed", [](Firmware &) {}, {ok, ok, ok, ok, ok, unsupported, ok}},
      {"second allocation",
       [](Firmware &f) { f.FailAllocation(2); },
       {ok, EFI_OUT_OF_RESOURCES, ok, ok, ok, unsupported, ok}},
      {"second AllocatePool",
       [](Firmware &f) { f.FailCall("AllocatePool", 2, EFI_VOLUME_FULL); },
       {ok, ok, EFI_VOLUME_FULL, ok, ok, unsupported, ok}},
      {"both at once",
       [](Firmware &f) {
         f.FailAllocation(1, EFI_ABORTED);
         f.FailCall("AllocatePool", 2);
       },
       {EFI_ABORTED, ok, EFI_DEVICE_ERROR, ok, ok, unsupported, ok}},
      {"second LoadedImage lookup only",
       [](Firmware &f) { f.FailCall("HandleProtocol", 2, EFI_NOT_FOUND, &gEfiLoadedImageProtocolGuid); },
       {ok, ok, ok, ok, ok, unsupported, EFI_NOT_FOUND}},
  };
  for (const Row &row : rows) {
    Firmware fw;
    EFI_BOOT_SERVICES *bs = fw.BootServices();
    row.arm(fw);
    std::vector<EFI_STATUS> got;
    for (int i = 0; i < 2; i++) {
      UINTN key = fw.MapKey();
      size_t blocks = fw.LivePoolBlocks();
      void *block = reinterpret_cast<void *>(0x1234);
      got.push_back(bs->AllocatePool(EfiLoaderData, 8, &block));
      if (EFI_ERROR(got.back())) {
        EXPECT_EQ(block, reinterpret_cast<void *>(0x1234)) << row.name;
        EXPECT_EQ(fw.LivePoolBlocks(), blocks) << row.name;
        EXPECT_EQ(fw.MapKey(), key) << row.name;
      }
      UINT64 pages = fw.AllocatedPages();
      EFI_PHYSICAL_ADDRESS address = 0x500000;
      got.push_back(bs->AllocatePages(AllocateAddress, EfiLoaderData, 1, &address));
      if (EFI_ERROR(got.back()))
        EXPECT_EQ(fw.AllocatedPages(), pages) << row.name;
      if (!EFI_ERROR(got.back()))
        bs->FreePages(address, 1);
    }
    void *interface = nullptr;
    got.push_back(bs->HandleProtocol(fw.ImageHandle(), &gEfiLoadedImageProtocolGuid, &interface));
    got.push_back(bs->HandleProtocol(fw.ImageHandle(), &gEfiDevicePathProtocolGuid, &interface));
    got.push_back(bs->HandleProtocol(fw.ImageHandle(), &gEfiLoadedImageProtocolGuid, &interface));
    EXPECT_EQ(got, row.expected) << row.name;
    EXPECT_EQ(fw.CallCount("AllocatePool"), 2u) << row.name;
    EXPECT_EQ(fw.CallCount("HandleProtocol"), 3u) << row.name;
  }
}

// --- Directory volumes ---------------------------------------------------------------------

class HostfwVolume : public ::testing::Test {
 protected:
  void SetUp() override {
    dir.File("EFI/Boot/Kernel.bin", "0123456789");
    dir.File("b.txt", "bee");
    dir.Directory("Extensions/A.drvb");
    device = fw.AddDirectoryVolume(dir.path(), 3);
    void *interface = nullptr;
    ASSERT_EQ(fw.BootServices()->HandleProtocol(device, &gEfiSimpleFileSystemProtocolGuid, &interface),
              EFI_SUCCESS);
    auto *fileSystem = static_cast<EFI_SIMPLE_FILE_SYSTEM_PROTOCOL *>(interface);
    ASSERT_EQ(fileSystem->OpenVolume(fileSystem, &root), EFI_SUCCESS);
  }
  EFI_STATUS Open(EFI_FILE *from, const char16_t *name, EFI_FILE **file) {
    return from->Open(from, file, name, EFI_FILE_MODE_READ, 0);
  }
  std::vector<uint8_t> Info(EFI_FILE *file) {
    UINTN size = 0;
    EXPECT_EQ(file->GetInfo(file, &gEfiFileInfoGuid, &size, nullptr), EFI_BUFFER_TOO_SMALL);
    std::vector<uint8_t> info(size);
    EXPECT_EQ(file->GetInfo(file, &gEfiFileInfoGuid, &size, info.data()), EFI_SUCCESS);
    EXPECT_EQ(size, info.size());
    return info;
  }
  static const EFI_FILE_INFO &AsInfo(const std::vector<uint8_t> &bytes) {
    return *reinterpret_cast<const EFI_FILE_INFO *>(bytes.data());
  }

  nimbtest::TempDir dir;
  Firmware fw;
  EFI_HANDLE device = nullptr;
  EFI_FILE *root = nullptr;
};

TEST_F(HostfwVolume, NamesResolveAsOnFat) {
  struct Row {
    const char16_t *name;
    EFI_STATUS expected;
    const char *content;  // of a file that opens; null for a directory
  };
  const Row rows[] = {
      {u"EFI\\Boot\\Kernel.bin", EFI_SUCCESS, "0123456789"},
      {u"efi\\BOOT\\kernel.BIN", EFI_SUCCESS, "0123456789"},
      {u"EFI\\.\\Boot\\..\\Boot\\\\Kernel.bin", EFI_SUCCESS, "0123456789"},
      {u"extensions\\a.DRVB", EFI_SUCCESS, nullptr},
      {u"extensions\\a.drvb\\", EFI_SUCCESS, nullptr},
      {u"", EFI_SUCCESS, nullptr},
      {u"missing", EFI_NOT_FOUND, nullptr},
      {u"b.txt\\", EFI_NOT_FOUND, nullptr},
      {u"EFI/Boot/Kernel.bin", EFI_NOT_FOUND, nullptr},
      {u"..", EFI_INVALID_PARAMETER, nullptr},
  };
  for (const Row &row : rows) {
    std::string name = fs::path(std::u16string(row.name)).string();
    EFI_FILE *file = nullptr;
    ASSERT_EQ(Open(root, row.name, &file), row.expected) << name;
    if (EFI_ERROR(row.expected))
      continue;
    bool directory = (AsInfo(Info(file)).Attribute & EFI_FILE_DIRECTORY) != 0;
    EXPECT_EQ(directory, row.content == nullptr) << name;
    if (row.content != nullptr) {
      char buffer[32] = {};
      UINTN size = sizeof(buffer);
      EXPECT_EQ(file->Read(file, &size, buffer), EFI_SUCCESS) << name;
      EXPECT_EQ(std::string(buffer, size), row.content) << name;
    }
    EXPECT_EQ(file->Close(file), EFI_SUCCESS);
  }
  // Relative names go from the directory they are opened in.
  EFI_FILE *boot = nullptr, *kernel = nullptr;
  ASSERT_EQ(Open(root, u"efi\\boot", &boot), EFI_SUCCESS);
  EXPECT_EQ(Open(boot, u"..\\..\\b.txt", &kernel), EFI_SUCCESS);
  EXPECT_EQ(Open(boot, u"\\b.txt", &kernel), EFI_SUCCESS);
  EXPECT_EQ(Open(boot, u"b.txt", &kernel), EFI_NOT_FOUND);
  EXPECT_EQ(root->Open(root, &kernel, u"b.txt", EFI_FILE_MODE_READ | EFI_FILE_MODE_WRITE, 0),
            EFI_WRITE_PROTECTED);
  EXPECT_EQ(root->Open(root, &kernel, u"b.txt", EFI_FILE_MODE_WRITE, 0), EFI_INVALID_PARAMETER);
  // The root, boot and the two that opened from it.
  EXPECT_EQ(fw.OpenFiles(), 4u);
  ASSERT_GE(fw.OpenedNames().size(), 2u);
  EXPECT_EQ(fw.OpenedNames().front(), "EFI\\Boot\\Kernel.bin");
  EXPECT_EQ(fw.ClosedNames().front(), "EFI\\Boot\\Kernel.bin");
}

TEST_F(HostfwVolume, ReadsFollowThePosition) {
  EFI_FILE *file = nullptr;
  ASSERT_EQ(Open(root, u"EFI\\Boot\\Kernel.bin", &file), EFI_SUCCESS);
  struct Row {
    UINT64 seek;  // ~0 - 1: no seek
    UINTN ask;
    const char *got;
    UINT64 positionAfter;
  };
  const UINT64 stay = ~0ULL - 1;
  const Row rows[] = {
      {stay, 4, "0123", 4}, {stay, 4, "4567", 8}, {stay, 4, "89", 10}, {stay, 4, "", 10},
      {3, 2, "34", 5},      {~0ULL, 4, "", 10},   {0, 0, "", 0},       {0, 100, "0123456789", 10},
  };
  for (const Row &row : rows) {
    if (row.seek != stay)
      ASSERT_EQ(file->SetPosition(file, row.seek), EFI_SUCCESS);
    char buffer[128];
    UINTN size = row.ask;
    EXPECT_EQ(file->Read(file, &size, buffer), EFI_SUCCESS);
    EXPECT_EQ(std::string(buffer, size), row.got);
    UINT64 position = 0;
    EXPECT_EQ(file->GetPosition(file, &position), EFI_SUCCESS);
    EXPECT_EQ(position, row.positionAfter);
  }
  // Past the end a read is a device error.
  ASSERT_EQ(file->SetPosition(file, 11), EFI_SUCCESS);
  char byte;
  UINTN one = 1;
  EXPECT_EQ(file->Read(file, &one, &byte), EFI_DEVICE_ERROR);
  EXPECT_EQ(file->Close(file), EFI_SUCCESS);
  EXPECT_EQ(fw.OpenFiles(), 1u);
}

TEST_F(HostfwVolume, InfoOfAFileAndTheVolumesDevicePath) {
  fw.SetFileTime(dir.path() + "/b.txt", 951782400 + 3723);  // 2000-02-29 01:02:03 UTC
  EFI_FILE *file = nullptr;
  ASSERT_EQ(Open(root, u"B.TXT", &file), EFI_SUCCESS);
  std::vector<uint8_t> bytes = Info(file);
  const EFI_FILE_INFO &info = AsInfo(bytes);
  EXPECT_EQ(info.Size, bytes.size());
  EXPECT_EQ(info.FileSize, 3u);
  EXPECT_EQ(info.Attribute & EFI_FILE_DIRECTORY, 0u);
  EXPECT_EQ(std::u16string(info.FileName), u"b.txt");
  const EFI_TIME &t = info.ModificationTime;
  EXPECT_EQ(std::vector<int>({t.Year, t.Month, t.Day, t.Hour, t.Minute, t.Second}),
            std::vector<int>({2000, 2, 29, 1, 2, 3}));
  UINTN small = SIZE_OF_EFI_FILE_INFO;
  std::vector<uint8_t> buffer(bytes.size());
  EXPECT_EQ(file->GetInfo(file, &gEfiFileInfoGuid, &small, buffer.data()), EFI_BUFFER_TOO_SMALL);
  EXPECT_EQ(small, bytes.size());
  file->Close(file);

  // The volume's device path ends in a hard drive node with its partition.
  const auto *node = reinterpret_cast<const uint8_t *>(fw.DevicePathOf(device));
  ASSERT_NE(node, nullptr);
  while (!(node[0] == MEDIA_DEVICE_PATH && node[1] == MEDIA_HARDDRIVE_DP)) {
    ASSERT_NE(node[0], END_DEVICE_PATH_TYPE);
    node += node[2] | (node[3] << 8);
  }
  UINT32 partition;
  std::memcpy(&partition, node + 4, 4);
  EXPECT_EQ(partition, 3u);
  node += node[2] | (node[3] << 8);
  EXPECT_EQ(std::vector<uint8_t>(node, node + 4), (std::vector<uint8_t>{0x7F, 0xFF, 4, 0}));
}

// --- Block devices --------------------------------------------------------------------------

TEST(HostfwBlockDevice, ReadsStayInsideThePartition) {
  Firmware fw;
  auto image = std::make_shared<std::vector<uint8_t>>(16 * 512);
  for (size_t i = 0; i < image->size(); i++)
    (*image)[i] = uint8_t(i / 512);
  EFI_HANDLE partition = fw.AddBlockDevice(image, 512, 4, 8);  // blocks 4 to 11
  void *interface = nullptr;
  ASSERT_EQ(fw.BootServices()->HandleProtocol(partition, &gEfiBlockIoProtocolGuid, &interface), EFI_SUCCESS);
  auto *blockIo = static_cast<EFI_BLOCK_IO_PROTOCOL *>(interface);
  ASSERT_EQ(fw.BootServices()->HandleProtocol(partition, &gEfiDiskIoProtocolGuid, &interface), EFI_SUCCESS);
  auto *diskIo = static_cast<EFI_DISK_IO_PROTOCOL *>(interface);
  const UINT32 media = blockIo->Media->MediaId;
  EXPECT_EQ(blockIo->Media->LastBlock, 7u);
  // DiskIO reads by byte offset inside the partition; the first byte read
  // is the image's block number.
  struct Row {
    UINT64 offset;
    UINTN size;
    EFI_STATUS expected;
    uint8_t first;
  };
  const Row rows[] = {{1030, 10, EFI_SUCCESS, 6},
                      {8 * 512 - 1, 1, EFI_SUCCESS, 11},
                      {8 * 512 - 1, 2, EFI_INVALID_PARAMETER, 0},
                      {~0ULL, 2, EFI_INVALID_PARAMETER, 0}};
  for (const Row &row : rows) {
    std::vector<uint8_t> buffer(row.size, 0xEE);
    EXPECT_EQ(diskIo->ReadDisk(diskIo, media, row.offset, row.size, buffer.data()), row.expected)
        << row.offset;
    if (row.expected == EFI_SUCCESS)
      EXPECT_EQ(buffer[0], row.first) << row.offset;
  }
  uint8_t byte;
  EXPECT_EQ(diskIo->ReadDisk(diskIo, media + 1, 0, 1, &byte), EFI_MEDIA_CHANGED);
}

// --- NVRAM ---------------------------------------------------------------------------------

TEST(HostfwVariables, GetSetAndDelete) {
  Firmware fw;
  EFI_RUNTIME_SERVICES *rt = fw.RuntimeServices();
  const UINT32 bsrt = EFI_VARIABLE_BOOTSERVICE_ACCESS | EFI_VARIABLE_RUNTIME_ACCESS;
  const UINT32 nvbs = EFI_VARIABLE_NON_VOLATILE | EFI_VARIABLE_BOOTSERVICE_ACCESS;
  fw.PutVariable(u"boot-args", kVendor, nvbs, {'-', 'v'});

  UINT32 attributes = 0;
  UINTN size = 0;
  char data[8] = {};
  EXPECT_EQ(rt->GetVariable(u"boot-args", &kVendor, &attributes, &size, nullptr), EFI_BUFFER_TOO_SMALL);
  EXPECT_EQ(rt->GetVariable(u"boot-args", &kVendor, &attributes, &size, data), EFI_SUCCESS);
  EXPECT_EQ(rt->GetVariable(u"boot-args", &gEfiFileInfoGuid, nullptr, &size, data), EFI_NOT_FOUND);
  EXPECT_EQ(rt->GetVariable(u"boot-args", &kVendor, nullptr, nullptr, data), EFI_INVALID_PARAMETER);
  EXPECT_EQ(rt->SetVariable(u"x", &kVendor, bsrt, 3, "abc"), EFI_SUCCESS);
  EXPECT_EQ(rt->SetVariable(u"x", &kVendor, nvbs, 1, "a"), EFI_INVALID_PARAMETER) << "other attributes";
  EXPECT_EQ(rt->SetVariable(u"y", &kVendor, EFI_VARIABLE_RUNTIME_ACCESS, 1, "a"), EFI_INVALID_PARAMETER);
  EXPECT_EQ(rt->SetVariable(u"y", &kVendor, 0, 0, nullptr), EFI_NOT_FOUND) << "delete missing";
  EXPECT_EQ(attributes, nvbs);
  EXPECT_EQ(std::string(data, size), "-v");
  ASSERT_NE(fw.FindVariable(u"x", kVendor), nullptr);
  EXPECT_EQ(fw.FindVariable(u"x", kVendor)->attributes, bsrt);

  // A size of 0 deletes; after ExitBootServices only runtime variables are seen.
  EXPECT_EQ(rt->SetVariable(u"boot-args", &kVendor, nvbs, 0, nullptr), EFI_SUCCESS);
  EXPECT_EQ(fw.FindVariable(u"boot-args", kVendor), nullptr);
  fw.PutVariable(u"boot-args", kVendor, nvbs, {'1'});
  ASSERT_EQ(fw.BootServices()->ExitBootServices(fw.ImageHandle(), fw.MapKey()), EFI_SUCCESS);
  size = sizeof(data);
  EXPECT_EQ(rt->GetVariable(u"boot-args", &kVendor, nullptr, &size, data), EFI_NOT_FOUND);
  size = sizeof(data);
  EXPECT_EQ(rt->GetVariable(u"x", &kVendor, nullptr, &size, data), EFI_SUCCESS);
  EXPECT_TRUE(fw.ViolationsAfterExit().empty());
}

// --- How a run ends ------------------------------------------------------------------------

EFI_STATUS EFIAPI ReturnsWarning(EFI_HANDLE, EFI_SYSTEM_TABLE *) {
  return 4;
}
EFI_STATUS EFIAPI ExitsAborted(EFI_HANDLE image, EFI_SYSTEM_TABLE *st) {
  st->BootServices->Exit(image, EFI_ABORTED, 0, nullptr);
  return EFI_SUCCESS;  // not reached
}
EFI_STATUS EFIAPI ExitsWithAWrongHandle(EFI_HANDLE, EFI_SYSTEM_TABLE *st) {
  return st->BootServices->Exit(st, EFI_ABORTED, 0, nullptr);
}
EFI_STATUS EFIAPI Resets(EFI_HANDLE, EFI_SYSTEM_TABLE *st) {
  st->RuntimeServices->ResetSystem(EfiResetWarm, EFI_DEVICE_ERROR, 0, nullptr);
  return EFI_SUCCESS;
}
EFI_STATUS EFIAPI EntersTheKernel(EFI_HANDLE, EFI_SYSTEM_TABLE *) {
  nimb::MachineDisableInterrupts();
  nimb::MachineCallGate(0x3FFFF000, 0x1234, 0x200000);
}
EFI_STATUS EFIAPI Halts(EFI_HANDLE, EFI_SYSTEM_TABLE *) {
  nimb::MachineHalt();
}

TEST(HostfwRun, EveryWayARunEnds) {
  struct Row {
    const char *name;
    EFI_IMAGE_ENTRY_POINT entry;
    RunEnd end;
    EFI_STATUS status;
  };
  const Row rows[] = {
      {"returns", ReturnsWarning, RunEnd::Returned, 4},
      {"exits", ExitsAborted, RunEnd::Exited, EFI_ABORTED},
      {"exit refused", ExitsWithAWrongHandle, RunEnd::Returned, EFI_INVALID_PARAMETER},
      {"resets", Resets, RunEnd::Reset, EFI_DEVICE_ERROR},
      {"enters the kernel", EntersTheKernel, RunEnd::KernelEntered, EFI_SUCCESS},
      {"halts", Halts, RunEnd::Halted, EFI_SUCCESS},
  };
  for (const Row &row : rows) {
    Firmware fw;
    RunResult result = fw.Run(row.entry);
    EXPECT_EQ(result.end, row.end) << row.name;
    EXPECT_EQ(result.status, row.status) << row.name;
    EXPECT_EQ(result.interruptsDisabled, row.end == RunEnd::KernelEntered) << row.name;
    if (row.end == RunEnd::Reset)
      EXPECT_EQ(result.resetType, EfiResetWarm);
    if (row.end == RunEnd::KernelEntered) {
      EXPECT_EQ(result.gateAddress, 0x3FFFF000u);
      EXPECT_EQ(result.gateArgument, 0x1234u);
      EXPECT_EQ(result.gateTarget, 0x200000u);
    }
  }

  // Call ends the same ways, and nests: an Exit ends the innermost.
  Firmware fw;
  RunResult inner;
  RunResult outer = fw.Call([&] {
    inner = fw.Call([&] { fw.BootServices()->Exit(fw.ImageHandle(), 7, 0, nullptr); });
    fw.RuntimeServices()->ResetSystem(EfiResetCold, 0, 0, nullptr);
  });
  EXPECT_EQ(inner.end, RunEnd::Exited);
  EXPECT_EQ(inner.status, 7u);
  EXPECT_EQ(outer.end, RunEnd::Reset);
  // A ResetSystem that is made to fail comes back.
  fw.FailCall("ResetSystem");
  EXPECT_EQ(fw.Call([&] { fw.RuntimeServices()->ResetSystem(EfiResetCold, 0, 0, nullptr); }).end,
            RunEnd::Returned);
}

// --- After ExitBootServices ----------------------------------------------------------------

TEST(HostfwExitBootServices, LaterBootTimeCallsAreViolationsRuntimeOnesWork) {
  Firmware fw;
  EFI_SYSTEM_TABLE *st = fw.SystemTable();
  EFI_BOOT_SERVICES *bs = st->BootServices;
  EXPECT_EQ(st->RuntimeServices->SetVirtualAddressMap(0, hostfw::kDescriptorSize, 1, nullptr),
            EFI_UNSUPPORTED);
  std::vector<EFI_MEMORY_DESCRIPTOR> map = fw.MemoryMap();
  ASSERT_EQ(bs->ExitBootServices(fw.ImageHandle(), fw.MapKey()), EFI_SUCCESS);

  void *block = nullptr;
  EXPECT_EQ(bs->AllocatePool(EfiLoaderData, 8, &block), EFI_UNSUPPORTED);
  EXPECT_EQ(st->ConOut->OutputString(st->ConOut, u"late"), EFI_UNSUPPORTED);
  EXPECT_EQ(bs->ExitBootServices(fw.ImageHandle(), fw.MapKey()), EFI_UNSUPPORTED);
  EXPECT_EQ(fw.ViolationsAfterExit(),
            (std::vector<std::string>{"AllocatePool", "OutputString", "ExitBootServices"}));
  EXPECT_TRUE(fw.ConOutCalls().empty());
  EXPECT_EQ(fw.LivePoolBlocks(), 0u);

  // The map goes to SetVirtualAddressMap by its own stride, once.
  std::vector<uint8_t> bytes(map.size() * hostfw::kDescriptorSize, 0xEE);
  for (size_t i = 0; i < map.size(); i++) {
    map[i].VirtualStart = map[i].PhysicalStart + 0x1000;
    std::memcpy(&bytes[i * hostfw::kDescriptorSize], &map[i], sizeof(map[i]));
  }
  auto *descriptors = reinterpret_cast<EFI_MEMORY_DESCRIPTOR *>(bytes.data());
  // The call converts the system table's own pointers to the new addresses.
  EFI_RUNTIME_SERVICES *rt = st->RuntimeServices;
  EXPECT_EQ(rt->SetVirtualAddressMap(bytes.size(), hostfw::kDescriptorSize, 2, descriptors),
            EFI_INVALID_PARAMETER);
  EXPECT_EQ(rt->SetVirtualAddressMap(bytes.size(), hostfw::kDescriptorSize, 1, descriptors), EFI_SUCCESS);
  EXPECT_EQ(reinterpret_cast<UINT64>(st->RuntimeServices), reinterpret_cast<UINT64>(rt) + 0x1000);
  ASSERT_TRUE(fw.VirtualMapSet());
  ASSERT_EQ(fw.VirtualMap().size(), map.size());
  EXPECT_EQ(fw.VirtualMap().back().VirtualStart, map.back().PhysicalStart + 0x1000);
  EXPECT_EQ(rt->SetVirtualAddressMap(bytes.size(), hostfw::kDescriptorSize, 1, descriptors), EFI_UNSUPPORTED);
  EXPECT_EQ(fw.ViolationsAfterExit().size(), 3u);
}

// --- Protocols, events and nested firmware ----------------------------------------------------

void EFIAPI CountTick(EFI_EVENT, void *context) {
  ++*static_cast<int *>(context);
}

TEST(HostfwHandles, ConsoleControlProtocolsAndTimers) {
  Firmware fw;
  EFI_BOOT_SERVICES *bs = fw.BootServices();
  void *interface = nullptr;
  ASSERT_EQ(bs->LocateProtocol(&gEfiConsoleControlProtocolGuid, nullptr, &interface), EFI_SUCCESS);
  auto *control = static_cast<EFI_CONSOLE_CONTROL_PROTOCOL *>(interface);
  EFI_CONSOLE_CONTROL_SCREEN_MODE mode = EfiConsoleControlScreenText;
  EXPECT_EQ(control->GetMode(control, &mode, nullptr, nullptr), EFI_SUCCESS);
  EXPECT_EQ(mode, EfiConsoleControlScreenGraphics);
  fw.SetConsoleControlPresent(false);
  EXPECT_EQ(bs->LocateProtocol(&gEfiConsoleControlProtocolGuid, nullptr, &interface), EFI_NOT_FOUND);

  // A protocol the handle lacks, and no handle.
  EXPECT_EQ(bs->HandleProtocol(fw.ImageHandle(), &gEfiDiskIoProtocolGuid, &interface), EFI_UNSUPPORTED);
  EXPECT_EQ(bs->HandleProtocol(nullptr, &gEfiLoadedImageProtocolGuid, &interface), EFI_INVALID_PARAMETER);

  // A timer's notify function runs when fired, and no more once closed.
  int ticks = 0;
  EFI_EVENT event = nullptr;
  ASSERT_EQ(bs->CreateEvent(EVT_TIMER | EVT_NOTIFY_SIGNAL, TPL_NOTIFY, CountTick, &ticks, &event),
            EFI_SUCCESS);
  fw.FireEvent(event);
  EXPECT_EQ(ticks, 0);  // not set yet
  ASSERT_EQ(bs->SetTimer(event, TimerPeriodic, 1000000), EFI_SUCCESS);
  fw.FireEvent(event);
  fw.FireEvent(event);
  ASSERT_EQ(bs->CloseEvent(event), EFI_SUCCESS);
  fw.FireEvent(event);
  EXPECT_EQ(ticks, 2);
  ASSERT_EQ(fw.Events().size(), 1u);
  EXPECT_EQ(fw.Events()[0].triggerTime, 1000000u);
  EXPECT_TRUE(fw.Events()[0].closed);
  EXPECT_EQ(bs->SetTimer(event, TimerCancel, 0), EFI_INVALID_PARAMETER);
}

TEST(HostfwNested, AnInnerFirmwareLeavesTheOuterAsItWas) {
  Firmware outer;
  EFI_PHYSICAL_ADDRESS page = 0x300000;
  ASSERT_EQ(outer.BootServices()->AllocatePages(AllocateAddress, EfiLoaderData, 1, &page), EFI_SUCCESS);
  std::memcpy(reinterpret_cast<void *>(page), "outer", 6);
  outer.SetConOutPresent(false);
  {
    Firmware inner;
    EXPECT_EQ(Firmware::Active(), &inner);
    EXPECT_NE(inner.SystemTable()->ConOut, nullptr);
    EFI_PHYSICAL_ADDRESS same = 0x300000;
    ASSERT_EQ(inner.BootServices()->AllocatePages(AllocateAddress, EfiLoaderData, 1, &same), EFI_SUCCESS);
    std::memcpy(reinterpret_cast<void *>(same), "inner", 6);
  }
  EXPECT_EQ(Firmware::Active(), &outer);
  EXPECT_STREQ(reinterpret_cast<const char *>(page), "outer");
  EXPECT_EQ(outer.SystemTable()->ConOut, nullptr);
  EXPECT_EQ(outer.SystemTable()->Hdr.Signature, EFI_SYSTEM_TABLE_SIGNATURE);
  EXPECT_EQ(outer.BootServices()->FreePages(page, 1), EFI_SUCCESS);
  EXPECT_EQ(outer.AllocatedPages(), 0u);
}

}  // namespace
