// The records of a kernel image: the fat file that may wrap kernel objects
// for several processors, and the Nimb-O kernel object itself. The loader
// reads them and the host tool that makes kernel objects writes them, both
// from these definitions.
//
// Every field is an unsigned 32-bit word. A kernel object is little-endian;
// the header and slice records of a fat file are in the byte order that its
// magic tells.
#pragma once

#include <stddef.h>
#include <stdint.h>

namespace nimb {

// The fat magic as one little-endian word: the bytes BE BA FE CA mean a fat
// file whose records are little-endian, the bytes CA FE BA BE one whose
// records are big-endian.
constexpr uint32_t kFatMagic = 0xCAFEBABE;
constexpr uint32_t kFatMagicSwapped = 0xBEBAFECA;

struct FatHeader {
  uint32_t magic;
  uint32_t sliceCount;  // slice records that follow at once
};

struct FatSlice {
  uint32_t cpuType;     // processor of the slice
  uint32_t cpuSubtype;  // not read by the loader
  uint32_t offset;      // from the start of the fat file
  uint32_t size;        // bytes of the slice
  uint32_t alignment;   // power of two, not read by the loader
};

constexpr uint32_t kObjectMagic = 0xFEEDFACE;
constexpr uint32_t kObjectFileTypeExecutable = 2;

struct ObjectHeader {
  uint32_t magic;
  uint32_t cpuType;
  uint32_t cpuSubtype;
  uint32_t fileType;
  uint32_t commandCount;  // compared as a signed number
  uint32_t commandsSize;  // bytes of load commands that follow the header
  uint32_t flags;
};

constexpr uint32_t kLoadCommandSegment = 1;
constexpr uint32_t kLoadCommandThread = 5;

// The opening of every load command.
struct LoadCommand {
  uint32_t command;
  uint32_t commandLength;  // this header included
};

struct SegmentCommand {
  uint32_t command;  // kLoadCommandSegment
  uint32_t commandLength;
  char segmentName[16];  // not read by the loader
  uint32_t address;      // only the low 30 bits count: the physical address
  uint32_t memorySize;
  uint32_t fileOffset;  // from the start of the slice
  uint32_t fileSize;
};

// A thread command carries the register block of the 32-bit x86 processor:
// 16 words, of which the loader reads only the instruction pointer.
constexpr uint32_t kThreadFlavorX86 = 1;
constexpr uint32_t kThreadRegisterWords = 16;

struct ThreadCommand {
  uint32_t command;  // kLoadCommandThread
  uint32_t commandLength;
  uint32_t flavor;  // not read by the loader
  uint32_t count;   // register words; not read by the loader
  uint32_t registersBefore[10];
  uint32_t entry;  // the instruction pointer: the kernel's entry address
  uint32_t registersAfter[5];
};

// The part of an address (segment or entry) that the loader keeps.
constexpr uint32_t kKernelAddressMask = 0x3FFFFFFF;

static_assert(sizeof(FatHeader) == 8, "fat header");
static_assert(sizeof(FatSlice) == 20, "fat slice record");
static_assert(offsetof(FatSlice, offset) == 8 && offsetof(FatSlice, size) == 12, "fat slice fields");
static_assert(sizeof(ObjectHeader) == 28, "object header");
static_assert(offsetof(ObjectHeader, commandCount) == 16 && offsetof(ObjectHeader, commandsSize) == 20,
              "object header fields");
static_assert(sizeof(LoadCommand) == 8, "load command opening");
static_assert(sizeof(SegmentCommand) == 40, "segment command fields");
static_assert(offsetof(SegmentCommand, address) == 24 && offsetof(SegmentCommand, memorySize) == 28 &&
                  offsetof(SegmentCommand, fileOffset) == 32 && offsetof(SegmentCommand, fileSize) == 36,
              "segment command fields");
static_assert(offsetof(ThreadCommand, entry) == 56, "entry word of the register block");
static_assert(sizeof(ThreadCommand) == 16 + 4 * kThreadRegisterWords, "thread command");

}  // namespace nimb
