#include "kcache/cache_writer.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstdio>
#include <cstring>

#include "boot/boot.h"
#include "config/boot_options.h"
#include "devicetree/platform.h"
#include "kcache/lzss_encoder.h"
#include "load/kernel_cache.h"
#include "support/checksum.h"
#include "support/text.h"

namespace kcache {

namespace {

void PutBig32(uint8_t *at, uint32_t value) {
  at[0] = static_cast<uint8_t>(value >> 24);
  at[1] = static_cast<uint8_t>(value >> 16);
  at[2] = static_cast<uint8_t>(value >> 8);
  at[3] = static_cast<uint8_t>(value);
}

void PutBytes(uint8_t *at, uint32_t bytes) {
  std::memcpy(at, &bytes, 4);
}

}  // namespace

std::string CheckDevicePath(const std::vector<uint8_t> &bytes) {
  size_t at = 0;
  while (at + 4 <= bytes.size()) {
    const size_t length = bytes[at + 2] | bytes[at + 3] << 8;
    if (length < 4 || at + length > bytes.size()) {
      return "the node at byte " + std::to_string(at) + " has a length of " + std::to_string(length) +
             ", which does not fit";
    }
    if ((bytes[at] & 0x7F) == 0x7F && bytes[at + 1] == 0xFF) {
      if (at + 4 != bytes.size()) {
        return "bytes follow the end node at byte " + std::to_string(at);
      }
      return "";
    }
    at += length;
  }
  return "no end node (7F FF 04 00) at the end";
}

CacheKey MakeCacheKey(const std::string &model, const std::vector<uint8_t> &bootPath,
                      const std::string &kernelName) {
  // The loader's own routine, over its globals, which are put back after.
  char savedModel[sizeof(nimb::gModelName)];
  std::memcpy(savedModel, nimb::gModelName, sizeof savedModel);
  EFI_DEVICE_PATH_PROTOCOL *const savedPath = nimb::gBootDevicePath;
  const CHAR16 *const savedName = nimb::gKernelName;

  std::memset(nimb::gModelName, 0, sizeof(nimb::gModelName));
  std::memcpy(nimb::gModelName, model.data(), std::min(model.size(), sizeof(nimb::gModelName)));
  std::vector<uint8_t> path = bootPath;
  nimb::gBootDevicePath = reinterpret_cast<EFI_DEVICE_PATH_PROTOCOL *>(path.data());
  // The loader holds the name in UCS-2.
  std::vector<CHAR16> wide(kernelName.size() + 1);
  UINT64 units = 0;
  nimb::Utf8ToUcs(reinterpret_cast<const UINT8 *>(kernelName.c_str()), kernelName.size(),
                  reinterpret_cast<UINT16 *>(wide.data()), &units, wide.size() * sizeof(CHAR16));
  nimb::gKernelName = wide.data();
  nimb::MakeKernelCacheKey();
  CacheKey key;
  std::memcpy(key.data(), nimb::gKernelCacheKey, key.size());

  std::memcpy(nimb::gModelName, savedModel, sizeof savedModel);
  nimb::gBootDevicePath = savedPath;
  nimb::gKernelName = savedName;
  return key;
}

std::string CacheKeySuffix(const CacheKey &key) {
  char digits[9];
  std::snprintf(digits, sizeof digits, "%08X", nimb::Adler32(key.data(), key.size()));
  return digits;
}

std::string CacheFileName(const CacheKey &key) {
  std::string name;
  for (const char16_t *c = NIMB_KERNEL_CACHE_DEFAULT; *c != 0; c++) {
    name += *c == u'\\' ? '/' : static_cast<char>(*c);
  }
  return name + "." + CacheKeySuffix(key);
}

std::vector<uint8_t> WriteCache(const std::vector<uint8_t> &kernel, const CacheKey &key, bool matchFields) {
  const std::vector<uint8_t> stream = CompressLzss(kernel.data(), kernel.size());
  std::vector<uint8_t> file(nimb::kCacheHeaderBytes);
  nimb::CacheHeader *header = reinterpret_cast<nimb::CacheHeader *>(file.data());
  PutBig32(header->signature, nimb::kCacheSignature);
  PutBig32(header->compressType, nimb::kCacheCompressLzss);
  // The loader's checksum word lies in memory in big-endian order already.
  PutBytes(header->adler32, nimb::Adler32(kernel.data(), kernel.size()));
  PutBig32(header->uncompressedSize, static_cast<uint32_t>(kernel.size()));
  PutBig32(header->compressedSize, static_cast<uint32_t>(stream.size()));
  if (matchFields) {
    std::memcpy(header->modelName, key.data(), nimb::kCacheModelBytes);
    std::memcpy(header->bootPath, key.data() + nimb::kCacheModelBytes, nimb::kCacheBootPathBytes);
  }
  file.insert(file.end(), stream.begin(), stream.end());
  return file;
}

timespec CacheTime(const timespec &kernel, const timespec &extensions) {
  timespec time = extensions.tv_sec > kernel.tv_sec ? extensions : kernel;
  time.tv_sec += 1;
  return time;
}

std::string SetCacheTime(const std::string &cache, const std::string &kernel, const std::string &extensions) {
  struct stat kernelStat = {}, extensionsStat = {};
  if (stat(kernel.c_str(), &kernelStat) != 0) {
    return kernel + ": " + std::strerror(errno);
  }
  timespec time = kernelStat.st_mtim;
  if (!extensions.empty()) {
    if (stat(extensions.c_str(), &extensionsStat) != 0) {
      return extensions + ": " + std::strerror(errno);
    }
    time = CacheTime(kernelStat.st_mtim, extensionsStat.st_mtim);
  } else {
    time.tv_sec += 1;
  }
  const timespec times[2] = {time, time};
  if (utimensat(AT_FDCWD, cache.c_str(), times, 0) != 0) {
    return cache + ": cannot set its time: " + std::strerror(errno);
  }
  return "";
}

}  // namespace kcache
