// Builders of kernel image bytes for the tests, written out field by field
// so that they do not share the faults of the code under test: kernel
// objects with any commands, fat files in either order, 32-bit ELF files.
#pragma once

#include <cstdint>
#include <cstring>
#include <ctime>
#include <string>
#include <vector>

namespace nimbtest {

using Bytes = std::vector<uint8_t>;

// `value` as `width` bytes at `at`, growing `bytes` to hold them.
inline void Put(Bytes &bytes, size_t at, uint32_t value, size_t width, bool bigEndian = false) {
  if (bytes.size() < at + width)
    bytes.resize(at + width);
  for (size_t i = 0; i < width; i++)
    bytes[at + i] = static_cast<uint8_t>(value >> (8 * (bigEndian ? width - 1 - i : i)));
}
inline void PutLe32(Bytes &bytes, size_t at, uint32_t value) {
  Put(bytes, at, value, 4);
}
inline void PutBe32(Bytes &bytes, size_t at, uint32_t value) {
  Put(bytes, at, value, 4, true);
}
inline void PutLe16(Bytes &bytes, size_t at, uint32_t value) {
  Put(bytes, at, value, 2);
}

inline uint32_t GetLe32(const Bytes &bytes, size_t at) {
  return bytes[at] | bytes[at + 1] << 8 | bytes[at + 2] << 16 | static_cast<uint32_t>(bytes[at + 3]) << 24;
}

// Bytes of the host firmware's memory, at their physical address.
inline Bytes Memory(uint64_t address, uint64_t size) {
  const auto *at = reinterpret_cast<const uint8_t *>(static_cast<uintptr_t>(address));
  return Bytes(at, at + size);
}

inline Bytes Pattern(size_t size, unsigned seed = 1) {
  Bytes bytes(size);
  for (size_t i = 0; i < size; i++)
    bytes[i] = static_cast<uint8_t>(i * 13 + seed * 101 + (i >> 8));
  return bytes;
}

// Seconds since 1970 in UTC, as the host firmware's SetFileTime takes them.
inline int64_t UtcSeconds(int year, int month, int day, int hour, int minute, int second) {
  std::tm tm = {};
  tm.tm_year = year - 1900, tm.tm_mon = month - 1, tm.tm_mday = day;
  tm.tm_hour = hour, tm.tm_min = minute, tm.tm_sec = second;
  return timegm(&tm);
}

// The standard Adler-32, written out here so as not to share the loader's faults.
inline uint32_t ReferenceAdler32(const uint8_t *data, size_t length) {
  uint32_t a = 1, b = 0;
  for (size_t i = 0; i < length; i++) {
    a = (a + data[i]) % 65521;
    b = (b + a) % 65521;
  }
  return b << 16 | a;
}

// --- kernel objects -------------------------------------------------------------

// A load command that states `length` and is that long (at least 8 bytes):
// type, length, then `words`, the rest zero.
inline Bytes Command(uint32_t type, uint32_t length, const std::vector<uint32_t> &words = {}) {
  Bytes command(8 + 4 * words.size());
  PutLe32(command, 0, type);
  for (size_t i = 0; i < words.size(); i++)
    PutLe32(command, 8 + 4 * i, words[i]);
  PutLe32(command, 4, length);
  command.resize(length < 8 ? 8 : length);
  return command;
}

// A segment command: name (16 bytes of zero), then its four fields.
inline Bytes Segment(uint32_t address, uint32_t memorySize, uint32_t fileOffset, uint32_t fileSize,
                     uint32_t length = 56) {
  return Command(1, length, {0, 0, 0, 0, address, memorySize, fileOffset, fileSize, 7, 7});
}

// A thread command with the entry at byte 56 of its 80, between register
// words that must not be taken for it.
inline Bytes Thread(uint32_t entry, uint32_t length = 80) {
  std::vector<uint32_t> words(18, 0);
  words[0] = 1;
  words[1] = 16;
  words[11] = 0x11111111;
  words[12] = entry;
  words[13] = 0x22222222;
  return Command(5, length, words);
}

// Segment data lies at this offset of the object, behind the commands.
constexpr uint32_t kObjectDataStart = 0x1000;

struct Object {
  uint32_t magic = 0xFEEDFACE;
  std::vector<Bytes> commands;
  Bytes data;                 // at kObjectDataStart
  int64_t commandCount = -1;  // -1: the number of commands
  int64_t commandsSize = -1;  // -1: their total length
  size_t cutAt = SIZE_MAX;    // the object ends here when smaller

  Bytes Build() const {
    Bytes out(28);
    size_t size = 0;
    for (const Bytes &command : commands) {
      out.insert(out.end(), command.begin(), command.end());
      size += command.size();
    }
    const auto count = static_cast<uint32_t>(commandCount >= 0 ? commandCount : commands.size());
    const auto length = static_cast<uint32_t>(commandsSize >= 0 ? commandsSize : size);
    // Magic, processor, subtype, file type, count, size, flags.
    const uint32_t header[] = {magic, 7, 3, 2, count, length, 0};
    for (size_t i = 0; i < 7; i++)
      PutLe32(out, 4 * i, header[i]);
    if (!data.empty()) {
      out.resize(kObjectDataStart);
      out.insert(out.end(), data.begin(), data.end());
    }
    if (out.size() > cutAt)
      out.resize(cutAt);
    return out;
  }
};

// --- fat files ----------------------------------------------------------------------

struct FatRecord {
  uint32_t cpuType;
  uint32_t offset;
  uint32_t size;
  uint32_t cpuSubtype = 0x5A5A5A5A;  // not read: must not matter in either order
  uint32_t alignment = 0xA5A5A5A5;
};

struct FatContent {
  uint32_t offset;
  Bytes bytes;
};

// A fat file: header, the records, and each content at its offset. With
// `sliceCount` set, the header claims that many records.
inline Bytes Fat(bool bigEndian, const std::vector<FatRecord> &records,
                 const std::vector<FatContent> &contents, int64_t sliceCount = -1) {
  auto put = bigEndian ? PutBe32 : PutLe32;
  Bytes out;
  put(out, 0, 0xCAFEBABE);
  put(out, 4, static_cast<uint32_t>(sliceCount >= 0 ? sliceCount : records.size()));
  for (size_t i = 0; i < records.size(); i++) {
    const FatRecord &r = records[i];
    const uint32_t fields[] = {r.cpuType, r.cpuSubtype, r.offset, r.size, r.alignment};
    for (size_t field = 0; field < 5; field++)
      put(out, 8 + 20 * i + 4 * field, fields[field]);
  }
  for (const FatContent &content : contents) {
    if (out.size() < content.offset + content.bytes.size())
      out.resize(content.offset + content.bytes.size());
    std::memcpy(out.data() + content.offset, content.bytes.data(), content.bytes.size());
  }
  return out;
}

// --- ELF executables ---------------------------------------------------------------

struct ElfSegment {
  uint32_t type = 1;  // PT_LOAD
  uint32_t vaddr = 0;
  uint32_t paddr = 0;
  Bytes bytes;
  uint32_t memorySize = 0;
};

// A 32-bit little-endian x86 executable: ELF header, program headers at
// byte 52, each segment's bytes at a 4096-byte boundary. The fields can be
// spoilt afterwards by offset.
inline Bytes Elf(uint32_t entry, const std::vector<ElfSegment> &segments) {
  Bytes out(52 + 32 * segments.size());
  const uint8_t ident[] = {0x7F, 'E', 'L', 'F', 1, 1, 1};
  std::memcpy(out.data(), ident, sizeof(ident));
  PutLe16(out, 16, 2);  // ET_EXEC
  PutLe16(out, 18, 3);  // EM_386
  PutLe32(out, 20, 1);
  PutLe32(out, 24, entry);
  PutLe32(out, 28, 52);
  PutLe16(out, 40, 52);
  PutLe16(out, 42, 32);
  PutLe16(out, 44, static_cast<uint32_t>(segments.size()));
  for (size_t i = 0; i < segments.size(); i++) {
    const ElfSegment &segment = segments[i];
    size_t offset = (out.size() + 0xFFF) & ~size_t{0xFFF};
    out.resize(offset);
    out.insert(out.end(), segment.bytes.begin(), segment.bytes.end());
    const auto fileOffset = static_cast<uint32_t>(offset),
               fileSize = static_cast<uint32_t>(segment.bytes.size());
    const uint32_t fields[] = {segment.type,       fileOffset, segment.vaddr, segment.paddr, fileSize,
                               segment.memorySize, 6,          0x1000};
    for (size_t field = 0; field < 8; field++)
      PutLe32(out, 52 + 32 * i + 4 * field, fields[field]);
  }
  return out;
}

}  // namespace nimbtest
