// Any bytes as a hibernated image on a partition, its header at offset 0 and
// a restart asked for: TryResume must end in a reset or at the gate, touch
// no memory but what it took (the free memory is guarded and faults), and
// before the exit from boot services give everything back to TrackedFreeAll.

#include "fuzz_firmware.h"
#include "resume/resume.h"
#include "tests/unit/resume_image.h"

// The memory the resume may take: the rest of the arena is reserved, so
// that a header asking for a gigabyte is refused at once.
constexpr UINT64 kUsableMemory = 16ull << 20;
constexpr UINT64 kPartitionStart = 64;    // blocks
constexpr UINT64 kPartitionBlocks = 512;  // 256 KiB
constexpr UINT64 kGate = 0x7000;

struct Machine {
  hostfw::Firmware fw;
  std::shared_ptr<std::vector<uint8_t>> disk =
      std::make_shared<std::vector<uint8_t>>((kPartitionStart + kPartitionBlocks) * 512);

  Machine() {
    nimbfuzz::Quiet(fw, kUsableMemory);
    fw.InstallAcpi({});
    EFI_HANDLE partition = fw.AddBlockDevice(disk, 512, kPartitionStart, kPartitionBlocks);
    fw.PutVariable(nimb::kResumeImageVariable, gNimbVendorVariableGuid, nimbtest::kResumeVariableAttributes,
                   nimbtest::ResumeImageVariable(fw.DevicePathOf(partition), u"0"));
    fw.GuardFreeMemory();
  }
};

// Never destroyed at exit: the host firmware's own bookkeeping may be gone by then.
Machine *gMachine = nullptr;

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  if (gMachine == nullptr)
    gMachine = new Machine;
  hostfw::Firmware &fw = gMachine->fw;
  nimbfuzz::AttachLoader(fw);
  nimb::gCallGate = kGate;
  Check(fw.LivePoolBlocks() == 0 && fw.AllocatedPages() == 0);

  std::vector<uint8_t> &disk = *gMachine->disk;
  std::memset(disk.data(), 0, disk.size());
  std::memcpy(disk.data() + kPartitionStart * 512, data, std::min<size_t>(size, kPartitionBlocks * 512));
  const UINT32 attributes = nimbtest::kResumeVariableAttributes;
  fw.PutVariable(nimb::kResumeSignatureVariable, gNimbVendorVariableGuid, attributes, {1});
  fw.PutVariable(nimb::kResumeKeyVariable, gNimbVendorVariableGuid, attributes,
                 std::vector<uint8_t>(16, 0x4B));

  hostfw::RunResult result = fw.Call([] { nimb::TryResume(); });
  Check(result.end == hostfw::RunEnd::Reset || result.end == hostfw::RunEnd::KernelEntered);
  Check(fw.FindVariable(nimb::kResumeSignatureVariable, gNimbVendorVariableGuid) == nullptr);
  if (result.end == hostfw::RunEnd::KernelEntered) {
    Check(result.interruptsDisabled && result.gateAddress == kGate);
    Check(result.gateArgument < (1ull << 32) && result.gateArgument % 4096 == 0);
    const auto *header = reinterpret_cast<const nimb::ResumeHeader *>(result.gateArgument);
    Check(header->magic == nimb::kResumeMagic);
  }

  if (fw.BootServicesExited()) {
    // The firmware has been left (and its runtime moved): a new machine.
    delete gMachine;
    gMachine = nullptr;
  } else {
    nimb::TrackedFreeAll();
    Check(fw.LivePoolBlocks() == 0 && fw.AllocatedPages() == 0);
  }
  nimbfuzz::DetachLoader();
  return 0;
}
