// Making kernel objects on the host: reading a 32-bit x86 ELF executable,
// writing its loadable segments and entry point as a kernel object, and
// wrapping kernel objects into a fat file. The record layouts are the
// loader's own (load/kernel_format.h).
#pragma once

#include <cstdint>
#include <string>
#include <vector>

namespace kobj {

// One loadable segment.
struct Segment {
  uint32_t address = 0;        // where the loader places it (see ReadElf)
  uint32_t memorySize = 0;     // bytes in memory; the part beyond `bytes` is zero
  std::vector<uint8_t> bytes;  // what the file holds for it
};

struct Kernel {
  std::vector<Segment> segments;  // in program header order
  uint32_t entry = 0;
};

// Reads a 32-bit little-endian x86 ELF executable. Each PT_LOAD program
// header with a memory size becomes a segment at its physical address
// (p_paddr): that is the load address a linker script states with AT(),
// and it equals the virtual address when the script states none. The
// segments must be placeable as the loader places them: page-aligned, in
// pages of their own, below 4 GiB once the loader has kept the low 30 bits
// of their addresses, with the entry point inside one of them.
// Returns an empty string on success, else what is wrong with the file.
std::string ReadElf(const std::vector<uint8_t> &elf, Kernel *kernel);

// The kernel object: header, one segment command per segment, one thread
// command with the entry, then the segments' bytes.
std::vector<uint8_t> WriteObject(const Kernel &kernel);

enum class ByteOrder { kLittle, kBig };

// The processor subtype of the kernel's own slice and header: any 32-bit x86
// processor. The loader does not read it.
constexpr uint32_t kCpuSubtypeX86All = 3;

struct FatEntry {
  uint32_t cpuType = 0;
  uint32_t cpuSubtype = 0;
  std::vector<uint8_t> bytes;
};

// A fat file holding the slices in the given order, each at a 4096-byte
// boundary, with all fields of its records in `order`.
std::vector<uint8_t> WriteFat(const std::vector<FatEntry> &slices, ByteOrder order);

}  // namespace kobj
