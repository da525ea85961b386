// The kernel cache file: a 384-byte big-endian header, then the LZSS stream
// of a kernel object (or, without the "comp" signature, a plain kernel
// object or fat file as it stands). The loader reads it and the host tool
// that makes caches writes it, both from these definitions.
//
// The prelinked drivers of a cache travel inside the kernel object as one
// more segment (see kPrelinkMagic): the loader places it like any segment,
// and a kernel finds it on the page behind its own image.
#pragma once

#include <stddef.h>
#include <stdint.h>

namespace nimb {

// The four characters of `signature` and `compressType`, as big-endian words.
constexpr uint32_t kCacheSignature = 0x636F6D70;     // "comp"
constexpr uint32_t kCacheCompressLzss = 0x6C7A7373;  // "lzss"

constexpr size_t kCacheHeaderBytes = 384;
constexpr size_t kCacheModelBytes = 64;
constexpr size_t kCacheBootPathBytes = 256;
// The key whose Adler-32 names the cache file: the model name's 64 bytes,
// then the boot device path's bytes with the kernel's name (UTF-8, with its
// terminator) directly behind them, both within the next 256 bytes.
constexpr size_t kCacheKeyBytes = kCacheModelBytes + kCacheBootPathBytes;

// Every number big-endian.
struct CacheHeader {
  uint8_t signature[4];     // "comp"
  uint8_t compressType[4];  // "lzss"
  uint8_t adler32[4];       // of the uncompressed data
  uint8_t uncompressedSize[4];
  uint8_t compressedSize[4];  // bytes behind the header
  uint8_t reserved[44];
  uint8_t modelName[kCacheModelBytes];    // first byte 0: not compared
  uint8_t bootPath[kCacheBootPathBytes];  // first byte 0: not compared
};
static_assert(sizeof(CacheHeader) == kCacheHeaderBytes, "the header is 384 bytes");
static_assert(offsetof(CacheHeader, modelName) == 64 && offsetof(CacheHeader, bootPath) == 128,
              "model and boot path fields");

// The default name of a cache, relative to the boot directory; ".%08X" of
// the key's checksum follows.
#define NIMB_KERNEL_CACHE_DEFAULT u"System\\Library\\Caches\\com.quill.kernelcaches\\kernelcache"

// Prelinked drivers: the segment that a cache writer adds behind the kernel's
// own, on the first page boundary above its highest segment. Little-endian:
// the magic, the number of driver blocks, then the blocks, each on a page of
// its own (the first on the segment's second page) in the format of a staged
// driver: plist address, plist length, code address, code length, text, code.
constexpr uint32_t kPrelinkMagic = 0x4B4C504E;  // "NPLK"
struct PrelinkHeader {
  uint32_t magic;
  uint32_t driverCount;
};

}  // namespace nimb
