// Making kernel cache files on the host: the key whose checksum names the
// file, the 384-byte header and the compressed kernel behind it. The record
// layouts are the loader's own (load/kernel_cache_format.h), and the key and
// its checksum are the loader's own code's.
#pragma once

#include <time.h>

#include <array>
#include <cstdint>
#include <string>
#include <vector>

#include "load/kernel_cache_format.h"

namespace kcache {

using CacheKey = std::array<uint8_t, nimb::kCacheKeyBytes>;

// Checks that `bytes` are one device path, its end node last; returns an
// empty string, else what is wrong.
std::string CheckDevicePath(const std::vector<uint8_t> &bytes);

// The key as the loader builds it, by the loader's own MakeKernelCacheKey:
// the model name's bytes cut to 64, then the boot device path's bytes cut to
// 256 and the kernel's name (UTF-8, as far as it goes through the loader's
// UCS-2 form) with its terminator in the bytes left; zeros elsewhere. The
// model must not be empty, and `bootPath` must pass CheckDevicePath.
CacheKey MakeCacheKey(const std::string &model, const std::vector<uint8_t> &bootPath,
                      const std::string &kernelName);

// The file name's suffix: the loader's byte-reversed Adler-32 of the key,
// as 8 upper-case hex digits.
std::string CacheKeySuffix(const CacheKey &key);

// The name under which the loader looks for the cache, relative to the
// volume, with `/` between the parts.
std::string CacheFileName(const CacheKey &key);

// The cache file: header and compressed kernel. With `matchFields` the
// header repeats the key's model and boot path, else both fields are zero
// and the loader compares neither. The kernel must be below 4 GiB - 4 KiB.
std::vector<uint8_t> WriteCache(const std::vector<uint8_t> &kernel, const CacheKey &key, bool matchFields);

// The time the loader requires of a cache: one second after the newer of the
// kernel's and the extensions directory's (compared to the second, the
// kernel's on a tie), with the newer one's nanoseconds.
timespec CacheTime(const timespec &kernel, const timespec &extensions);

// Sets the cache file's modification time from the kernel's and, unless
// `extensions` is empty, the extensions directory's. Returns an empty
// string, else what went wrong.
std::string SetCacheTime(const std::string &cache, const std::string &kernel, const std::string &extensions);

}  // namespace kcache
