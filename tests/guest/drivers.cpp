#include "drivers.h"

#include "memory.h"
#include "report.h"
#include "text.h"

namespace nimb::guest {

namespace {

constexpr uint32_t kPageSize = 4096;
constexpr uint32_t kBlockHeader = 16;
// The prelinked segment's first word, "NPLK" (load/kernel_cache_format.h).
constexpr uint32_t kPrelinkMagic = 0x4B4C504E;
constexpr uint32_t kMaxIdentifier = 96;

// Where `needle` starts in the `length` bytes of `text`, or -1.
int32_t Find(const char *text, uint32_t length, const char *needle, uint32_t from) {
  const uint32_t size = TextLength(needle, 0xFFFFFFFFu);
  for (uint32_t at = from; at + size <= length; at++) {
    uint32_t i = 0;
    while (i < size && text[at + i] == needle[i]) {
      i++;
    }
    if (i == size) {
      return static_cast<int32_t>(at);
    }
  }
  return -1;
}

struct DriverTally {
  uint32_t blocks;
  uint32_t bad;
  const char *firstProblem;
  uint32_t problemAddress;
};

void Bad(DriverTally *tally, const char *problem, uint32_t address) {
  if (tally->bad++ == 0) {
    tally->firstProblem = problem;
    tally->problemAddress = address;
  }
}

// One staged block of `length` bytes at `address` (the range's length; 0
// for a prelinked block, whose length comes from its header), reported and
// checked. Returns the block's length by its header, 0 when unreadable.
uint32_t CheckBlock(uint32_t address, uint32_t length, const char *from, DriverTally *tally) {
  tally->blocks++;
  const uint8_t *header = GuestMemory(address, kBlockHeader);
  if (header == nullptr || (length != 0 && length < kBlockHeader)) {
    Bad(tally, "no header", address);
    return 0;
  }
  const uint32_t plistAddress = Le32(header), plistLength = Le32(header + 4);
  const uint32_t codeAddress = Le32(header + 8), codeLength = Le32(header + 12);
  const uint64_t total = static_cast<uint64_t>(kBlockHeader) + plistLength + codeLength;
  const uint8_t *text = GuestMemory(address + kBlockHeader, plistLength);
  const uint8_t *code = codeLength != 0 ? GuestMemory(codeAddress, codeLength) : nullptr;
  if (plistAddress != address + kBlockHeader) {
    Bad(tally, "text address is not the block's + 16", address);
  } else if (total > 0xFFFFFFFFu || (length != 0 && total != length)) {
    Bad(tally, "16 + text + code is not the range's length", address);
  } else if (plistLength == 0 || text == nullptr || text[plistLength - 1] != 0) {
    Bad(tally, "the text does not end in its zero", address);
  } else if (codeLength == 0 ? codeAddress != 0
                             : codeAddress != plistAddress + plistLength || code == nullptr) {
    Bad(tally, "code address is not behind the text", address);
  }
  char identifier[kMaxIdentifier];
  DriverIdentifier(reinterpret_cast<const char *>(text), text != nullptr ? plistLength : 0, identifier,
                   sizeof(identifier));
  LineStart();
  Print("driver ");
  PrintQuoted(identifier, sizeof(identifier));
  Print(" from=%s address=0x%x plist=0x%x code=0x%x sum=0x%x", from, address, plistLength, codeLength,
        code != nullptr ? Adler32(code, codeLength) : 1u);
  LineEnd();
  return total <= 0xFFFFFFFFu ? static_cast<uint32_t>(total) : 0;
}

// The prelinked segment, when the magic stands at the page behind the
// kernel's image: its blocks, each on a page of its own from the segment's
// second page on. Returns the number of blocks, or -1 without a segment.
int32_t CheckPrelinked(const KernelRegion &region, uint32_t imageEnd, DriverTally *tally) {
  const uint32_t segment = (imageEnd + kPageSize - 1) & ~(kPageSize - 1);
  const uint8_t *head = GuestMemory(segment, 8);
  if (head == nullptr || !Inside(segment, 8, region.base, region.runtimeStart) ||
      Le32(head) != kPrelinkMagic) {
    return -1;
  }
  const uint32_t count = Le32(head + 4);
  uint64_t at = static_cast<uint64_t>(segment) + kPageSize;
  for (uint32_t i = 0; i < count; i++) {
    if (!Inside(at, kBlockHeader, region.base, region.runtimeStart)) {
      Bad(tally, "prelinked block beyond the kernel region", static_cast<uint32_t>(at));
      break;
    }
    const uint32_t length = CheckBlock(static_cast<uint32_t>(at), 0, "cache", tally);
    if (length == 0 || !Inside(at, length, region.base, region.runtimeStart)) {
      Bad(tally, "prelinked block beyond the kernel region", static_cast<uint32_t>(at));
      break;
    }
    at = (at + length + kPageSize - 1) & ~static_cast<uint64_t>(kPageSize - 1);
  }
  return static_cast<int32_t>(count);
}

}  // namespace

uint32_t Adler32(const uint8_t *data, uint32_t length) {
  uint32_t a = 1, b = 0;
  while (length != 0) {
    // 5552 bytes keep b below 2^32 between reductions.
    uint32_t run = length < 5552 ? length : 5552;
    length -= run;
    while (run-- != 0) {
      a += *data++;
      b += a;
    }
    a %= 65521;
    b %= 65521;
  }
  return b << 16 | a;
}

void DriverIdentifier(const char *text, uint32_t length, char *out, uint32_t capacity) {
  out[0] = '?';
  out[1] = '\0';
  int32_t key = text != nullptr ? Find(text, length, "<key>VzBundleIdentifier</key>", 0) : -1;
  if (key < 0) {
    return;
  }
  int32_t start = Find(text, length, "<string>", static_cast<uint32_t>(key));
  if (start < 0) {
    return;
  }
  uint32_t at = static_cast<uint32_t>(start) + 8;
  uint32_t size = 0;
  while (at + size < length && text[at + size] != '<' && size + 1 < capacity) {
    out[size] = text[at + size];
    size++;
  }
  out[size] = '\0';
}

void CheckDrivers(const KernelRegion &region, uint32_t imageEnd, const Area *areas, uint32_t first,
                  uint32_t count) {
  DriverTally tally = {0, 0, nullptr, 0};
  uint32_t staged = 0;
  uint32_t packages = 0;
  for (uint32_t i = first; i < count; i++) {
    const Area &area = areas[i];
    if (StartsWith(area.name, "Driver-")) {
      staged++;
      CheckBlock(area.address, area.length, "loader", &tally);
    } else if (StartsWith(area.name, "DriversPackage-")) {
      packages++;
      const uint8_t *bytes = GuestMemory(area.address, area.length);
      Line("package address=0x%x length=0x%x sum=0x%x", area.address, area.length,
           bytes != nullptr ? Adler32(bytes, area.length) : 1u);
    }
  }
  const int32_t prelinked = CheckPrelinked(region, imageEnd, &tally);
  const char *from = prelinked >= 0 ? "cache" : staged + packages != 0 ? "loader" : "none";
  Line("drivers from=%s blocks=%u package=%u", from, tally.blocks, packages);
  if (tally.bad != 0) {
    Check("driver-blocks", false, "%u of %u blocks wrong; the first at 0x%x: %s", tally.bad, tally.blocks,
          tally.problemAddress, tally.firstProblem);
  } else {
    Check("driver-blocks", true, "%u blocks, each as its range and header say", tally.blocks);
  }
  Check("drivers-one-way", (prelinked >= 0) + (staged != 0) + (packages != 0) <= 1 && packages <= 1,
        "prelinked %d, staged %u, packages %u: at most one way, one package", prelinked, staged, packages);
}

}  // namespace nimb::guest
