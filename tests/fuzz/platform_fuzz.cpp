// The platform facts from fuzzed firmware: Data Hub records of any shape,
// and ACPI tables whose bytes, revisions and lengths are the input's. The
// addresses in the tables are the harness's (a root table entry or a DSDT
// field that is not 0 is made to point at the input's FACP or DSDT), and a
// table's length field never claims more than the table's bytes: those are
// the firmware's promises. The records go to /efi/platform, the model text
// stays inside its 64 bytes, and the tree gives back all it took.

#include "devicetree/devicetree.h"
#include "devicetree/platform.h"
#include "efi/datahub.h"
#include "fuzz_firmware.h"

void Put32(std::vector<uint8_t> &table, size_t at, uint64_t value) {
  for (size_t i = 0; i < 4 && at + i < table.size(); i++)
    table[at + i] = static_cast<uint8_t>(value >> (8 * i));
}
void Put64(std::vector<uint8_t> &table, size_t at, uint64_t value) {
  Put32(table, at, value);
  Put32(table, at + 4, value >> 32);
}
uint64_t Get32(const std::vector<uint8_t> &table, size_t at) {
  uint64_t value = 0;
  for (size_t i = 0; i < 4 && at + i < table.size(); i++)
    value |= static_cast<uint64_t>(table[at + i]) << (8 * i);
  return value;
}

// A table of the input's bytes, at least a header long, its length field
// held to its size.
std::vector<uint8_t> Table(FuzzedDataProvider &input, const char *signature) {
  std::string bytes = input.ConsumeRandomLengthString(512);
  std::vector<uint8_t> table(bytes.begin(), bytes.end());
  if (table.size() < 36)
    table.resize(36);
  if (signature != nullptr)
    std::memcpy(table.data(), signature, 4);
  if (Get32(table, 4) > table.size())
    Put32(table, 4, table.size());
  return table;
}

// Firmware pages holding `bytes`; the address.
uint64_t Place(hostfw::Firmware &fw, const std::vector<uint8_t> &bytes) {
  EFI_PHYSICAL_ADDRESS address = 0xFFFFFFFF;
  const UINTN pages = (bytes.size() + EFI_PAGE_SIZE - 1) / EFI_PAGE_SIZE;
  Check(fw.BootServices()->AllocatePages(AllocateMaxAddress, EfiACPIReclaimMemory, pages, &address) ==
        EFI_SUCCESS);
  std::memcpy(reinterpret_cast<void *>(address), bytes.data(), bytes.size());
  return address;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  FuzzedDataProvider input(data, size);
  hostfw::Firmware fw;
  nimbfuzz::Quiet(fw);
  nimbfuzz::AttachLoader(fw);
  std::memset(nimb::gModelName, 0, sizeof(nimb::gModelName));

  const unsigned records = input.ConsumeIntegralInRange<unsigned>(0, 6);
  for (unsigned i = 0; i < records; i++) {
    const bool ours = input.ConsumeBool();
    std::string bytes = input.ConsumeRandomLengthString(256);
    fw.AddDataHubRecordData(ours ? gNimbPlatformProducerGuid : gEfiDataHubProtocolGuid,
                            std::vector<uint8_t>(bytes.begin(), bytes.end()));
  }

  if (input.ConsumeBool()) {
    std::vector<uint8_t> dsdt = Table(input, "DSDT");
    std::vector<uint8_t> facp = Table(input, "FACP");
    std::vector<uint8_t> root = Table(input, nullptr);
    const uint64_t dsdtAt = Place(fw, dsdt);
    if (Get32(facp, 40) != 0)
      Put32(facp, 40, dsdtAt);
    if (Get32(facp, 140) != 0 || Get32(facp, 144) != 0)
      Put64(facp, 140, dsdtAt);
    const uint64_t facpAt = Place(fw, facp);
    const uint8_t revision = input.ConsumeIntegral<uint8_t>() % 4;
    const size_t entrySize = revision == 0 ? 4 : 8;
    for (size_t at = 36; at + entrySize <= Get32(root, 4); at += entrySize) {
      const uint64_t entry = Get32(root, at) | (entrySize == 8 ? Get32(root, at + 4) : 0);
      const uint64_t target = entry == 0 ? 0 : (entry & 1) ? facpAt : dsdtAt;
      entrySize == 4 ? Put32(root, at, target) : Put64(root, at, target);
    }
    const uint64_t rootAt = Place(fw, root);
    std::vector<uint8_t> rsdp(36);
    std::memcpy(rsdp.data(), "RSD PTR ", 8);
    rsdp[15] = revision;
    Put32(rsdp, 16, rootAt);
    Put64(rsdp, 24, rootAt);
    const uint64_t rsdpAt = Place(fw, rsdp);
    fw.AddConfigurationTable(input.ConsumeBool() ? gEfiAcpi20TableGuid : gEfiAcpi10TableGuid,
                             reinterpret_cast<void *>(rsdpAt));
  }

  const hostfw::RunResult run = fw.Call([] {
    nimb::InitPlatformDescription();
    const char *model = nimb::GetModelName();
    Check(model == nimb::gModelName && model[0] != '\0' && std::strlen(model) < sizeof(nimb::gModelName));
    nimb::FindFacp();
  });
  Check(run.end == hostfw::RunEnd::Returned);
  nimb::DeviceTreeFree();
  nimbfuzz::FinishInput(fw, false);
  return 0;
}
