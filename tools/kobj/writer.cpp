#include "kobj/writer.h"

#include <algorithm>
#include <cstddef>
#include <cstdio>

#include "load/kernel.h"
#include "load/kernel_format.h"

namespace kobj {

namespace {

using nimb::FatHeader;
using nimb::FatSlice;
using nimb::LoadCommand;
using nimb::ObjectHeader;
using nimb::SegmentCommand;
using nimb::ThreadCommand;

constexpr uint64_t kPageSize = 4096;
// The log2 of the slice alignment in a fat file.
constexpr uint32_t kSliceAlignmentShift = 12;
// Segment bytes start at this alignment in a kernel object.
constexpr uint64_t kDataAlignment = 16;

// What the ELF header and program headers hold, by offset (ELF32).
constexpr size_t kElfHeaderSize = 52;
constexpr size_t kElfClass = 4;
constexpr size_t kElfData = 5;
constexpr size_t kElfType = 16;
constexpr size_t kElfMachine = 18;
constexpr size_t kElfEntry = 24;
constexpr size_t kElfPhoff = 28;
constexpr size_t kElfPhentsize = 42;
constexpr size_t kElfPhnum = 44;
constexpr size_t kProgramHeaderSize = 32;
constexpr uint32_t kElfClass32 = 1;
constexpr uint32_t kElfClass64 = 2;
constexpr uint32_t kElfLittleEndian = 1;
constexpr uint32_t kElfTypeExecutable = 2;
constexpr uint32_t kElfTypeShared = 3;
constexpr uint32_t kElfMachineX86 = 3;
constexpr uint32_t kProgramLoad = 1;

uint32_t Get16(const std::vector<uint8_t> &bytes, size_t at) {
  return bytes[at] | bytes[at + 1] << 8;
}

uint32_t Get32(const std::vector<uint8_t> &bytes, size_t at) {
  return static_cast<uint32_t>(bytes[at]) | bytes[at + 1] << 8 | bytes[at + 2] << 16 |
         static_cast<uint32_t>(bytes[at + 3]) << 24;
}

void Put32(std::vector<uint8_t> &bytes, size_t at, uint32_t value, ByteOrder order = ByteOrder::kLittle) {
  for (size_t i = 0; i < 4; i++) {
    size_t shift = order == ByteOrder::kLittle ? 8 * i : 8 * (3 - i);
    bytes[at + i] = static_cast<uint8_t>(value >> shift);
  }
}

uint64_t AlignUp(uint64_t value, uint64_t alignment) {
  return (value + alignment - 1) / alignment * alignment;
}

std::string Hex(uint64_t value) {
  char text[32];
  std::snprintf(text, sizeof(text), "0x%llx", static_cast<unsigned long long>(value));
  return text;
}

// The address range that the loader takes for a segment: whole pages at the
// low 30 bits of its address.
struct Placement {
  size_t header;  // program header index, for messages
  uint64_t start;
  uint64_t end;
  uint64_t used;  // end of the memory size, before rounding
};

std::string CheckPlacements(std::vector<Placement> placements, uint32_t entry) {
  for (const Placement &p : placements) {
    if (p.start % kPageSize != 0) {
      return "program header " + std::to_string(p.header) + ": address " + Hex(p.start) +
             " is not on a 4096-byte boundary (the loader takes whole pages at the exact address; align "
             "each loadable segment with ALIGN(4096) in the linker script)";
    }
    if (p.end > 0x100000000ULL) {
      return "program header " + std::to_string(p.header) + ": segment at " + Hex(p.start) +
             " runs past 4 GiB";
    }
  }
  std::sort(placements.begin(), placements.end(),
            [](const Placement &a, const Placement &b) { return a.start < b.start; });
  for (size_t i = 1; i < placements.size(); i++) {
    if (placements[i].start < placements[i - 1].end) {
      return "program headers " + std::to_string(placements[i - 1].header) + " and " +
             std::to_string(placements[i].header) + " overlap in memory (segments at " +
             Hex(placements[i - 1].start) + " and " + Hex(placements[i].start) +
             " share a page once the loader keeps the low 30 bits of their addresses)";
    }
  }
  uint64_t masked = entry & nimb::kKernelAddressMask;
  for (const Placement &p : placements) {
    if (masked >= p.start && masked < p.used)
      return "";
  }
  return "entry point " + Hex(entry) + " lies in no loadable segment";
}

}  // namespace

std::string ReadElf(const std::vector<uint8_t> &elf, Kernel *kernel) {
  if (elf.size() < 4 || elf[0] != 0x7F || elf[1] != 'E' || elf[2] != 'L' || elf[3] != 'F')
    return "not an ELF file";
  if (elf.size() <= kElfClass)
    return "ELF header cut off";
  if (elf[kElfClass] == kElfClass64)
    return "a 64-bit ELF file: the kernel must be a 32-bit program (--target=i386-unknown-none-elf)";
  if (elf[kElfClass] != kElfClass32)
    return "unknown ELF class " + std::to_string(elf[kElfClass]);
  if (elf.size() < kElfHeaderSize)
    return "ELF header cut off";
  if (elf[kElfData] != kElfLittleEndian)
    return "not a little-endian ELF file";
  uint32_t type = Get16(elf, kElfType);
  if (type == kElfTypeShared)
    return "a position-independent or shared ELF file: link the kernel with --no-pie at fixed addresses";
  if (type != kElfTypeExecutable)
    return "not an executable (ELF type " + std::to_string(type) + "): link it into one with ld.lld";
  uint32_t machine = Get16(elf, kElfMachine);
  if (machine != kElfMachineX86)
    return "not a 32-bit x86 program (ELF machine " + std::to_string(machine) + ")";

  uint64_t phoff = Get32(elf, kElfPhoff);
  uint64_t phnum = Get16(elf, kElfPhnum);
  if (phnum != 0 && Get16(elf, kElfPhentsize) != kProgramHeaderSize)
    return "program headers of " + std::to_string(Get16(elf, kElfPhentsize)) + " bytes, not 32";
  if (phoff + phnum * kProgramHeaderSize > elf.size())
    return "program headers lie outside the file";

  Kernel result;
  result.entry = Get32(elf, kElfEntry);
  std::vector<Placement> placements;
  for (size_t i = 0; i < phnum; i++) {
    size_t at = phoff + i * kProgramHeaderSize;
    if (Get32(elf, at) != kProgramLoad)
      continue;
    uint64_t offset = Get32(elf, at + 4);
    uint32_t paddr = Get32(elf, at + 12);
    uint64_t fileSize = Get32(elf, at + 16);
    uint32_t memorySize = Get32(elf, at + 20);
    std::string where = "program header " + std::to_string(i) + ": ";
    if (fileSize > memorySize)
      return where + "more bytes in the file than in memory";
    if (offset + fileSize > elf.size())
      return where + "segment bytes lie outside the file";
    if (memorySize == 0)
      continue;
    Segment segment;
    segment.address = paddr;
    segment.memorySize = memorySize;
    segment.bytes.assign(elf.begin() + offset, elf.begin() + offset + fileSize);
    result.segments.push_back(std::move(segment));
    uint64_t start = paddr & nimb::kKernelAddressMask;
    placements.push_back({i, start, start + AlignUp(memorySize, kPageSize), start + memorySize});
  }
  if (result.segments.empty())
    return "no loadable segment (PT_LOAD) with a size in memory";
  std::string problem = CheckPlacements(placements, result.entry);
  if (!problem.empty())
    return problem;
  *kernel = std::move(result);
  return "";
}

std::vector<uint8_t> WriteObject(const Kernel &kernel) {
  uint32_t commandsSize =
      static_cast<uint32_t>(kernel.segments.size() * sizeof(SegmentCommand) + sizeof(ThreadCommand));
  uint64_t dataStart = AlignUp(sizeof(ObjectHeader) + commandsSize, kDataAlignment);
  std::vector<uint8_t> out(dataStart);

  Put32(out, offsetof(ObjectHeader, magic), nimb::kObjectMagic);
  Put32(out, offsetof(ObjectHeader, cpuType), nimb::kCpuTypeX86);
  Put32(out, offsetof(ObjectHeader, cpuSubtype), kCpuSubtypeX86All);
  Put32(out, offsetof(ObjectHeader, fileType), nimb::kObjectFileTypeExecutable);
  Put32(out, offsetof(ObjectHeader, commandCount), static_cast<uint32_t>(kernel.segments.size() + 1));
  Put32(out, offsetof(ObjectHeader, commandsSize), commandsSize);
  Put32(out, offsetof(ObjectHeader, flags), 0);

  size_t command = sizeof(ObjectHeader);
  for (size_t i = 0; i < kernel.segments.size(); i++) {
    const Segment &segment = kernel.segments[i];
    // The loader steps over a segment without file bytes: it would neither
    // take its pages nor clear them. A segment of zeroes alone therefore
    // carries one zero byte in the file.
    std::vector<uint8_t> bytes = segment.bytes;
    if (bytes.empty() && segment.memorySize != 0)
      bytes.push_back(0);
    uint64_t fileOffset = AlignUp(out.size(), kDataAlignment);
    out.resize(fileOffset);
    out.insert(out.end(), bytes.begin(), bytes.end());

    Put32(out, command + offsetof(SegmentCommand, command), nimb::kLoadCommandSegment);
    Put32(out, command + offsetof(SegmentCommand, commandLength), sizeof(SegmentCommand));
    std::snprintf(reinterpret_cast<char *>(&out[command + offsetof(SegmentCommand, segmentName)]),
                  sizeof(SegmentCommand::segmentName), "seg%zu", i);
    Put32(out, command + offsetof(SegmentCommand, address), segment.address);
    Put32(out, command + offsetof(SegmentCommand, memorySize), segment.memorySize);
    Put32(out, command + offsetof(SegmentCommand, fileOffset), static_cast<uint32_t>(fileOffset));
    Put32(out, command + offsetof(SegmentCommand, fileSize), static_cast<uint32_t>(bytes.size()));
    command += sizeof(SegmentCommand);
  }
  Put32(out, command + offsetof(ThreadCommand, command), nimb::kLoadCommandThread);
  Put32(out, command + offsetof(ThreadCommand, commandLength), sizeof(ThreadCommand));
  Put32(out, command + offsetof(ThreadCommand, flavor), nimb::kThreadFlavorX86);
  Put32(out, command + offsetof(ThreadCommand, count), nimb::kThreadRegisterWords);
  Put32(out, command + offsetof(ThreadCommand, entry), kernel.entry);
  return out;
}

std::vector<uint8_t> WriteFat(const std::vector<FatEntry> &slices, ByteOrder order) {
  std::vector<uint8_t> out(sizeof(FatHeader) + slices.size() * sizeof(FatSlice));
  // The magic's bytes tell the order: CA FE BA BE for big-endian records.
  Put32(out, offsetof(FatHeader, magic), nimb::kFatMagic, order);
  Put32(out, offsetof(FatHeader, sliceCount), static_cast<uint32_t>(slices.size()), order);
  for (size_t i = 0; i < slices.size(); i++) {
    uint64_t offset = AlignUp(out.size(), uint64_t{1} << kSliceAlignmentShift);
    out.resize(offset);
    out.insert(out.end(), slices[i].bytes.begin(), slices[i].bytes.end());
    size_t record = sizeof(FatHeader) + i * sizeof(FatSlice);
    Put32(out, record + offsetof(FatSlice, cpuType), slices[i].cpuType, order);
    Put32(out, record + offsetof(FatSlice, cpuSubtype), slices[i].cpuSubtype, order);
    Put32(out, record + offsetof(FatSlice, offset), static_cast<uint32_t>(offset), order);
    Put32(out, record + offsetof(FatSlice, size), static_cast<uint32_t>(slices[i].bytes.size()), order);
    Put32(out, record + offsetof(FatSlice, alignment), kSliceAlignmentShift, order);
  }
  return out;
}

}  // namespace kobj
