// Prelinked drivers: the driver bundles of an extensions directory, chosen
// and laid out as the loader stages them, put into the kernel object as one
// more segment (load/kernel_cache_format.h).
#pragma once

#include <cstdint>
#include <string>
#include <vector>

namespace kcache {

struct Driver {
  std::string bundle;         // the bundle's directory, for messages
  std::vector<uint8_t> text;  // the property list as the file has it
  std::vector<uint8_t> code;  // the code's 32-bit x86 slice; empty without code
};

// The kept bundles of `extensions` (those whose VzBundleRequired is a string
// other than "Safe Boot"), in both layouts, with the bundles in their PlugIns
// one level deep, each right behind its parent; entries in name order. A
// bundle whose code is named but missing, or has no 32-bit x86 slice, is left
// out as the loader leaves it out; a slice cut short by its file's end is
// filled up with zeros, as the loader stages it. Returns an empty string, else what is wrong.
std::string CollectDrivers(const std::string &extensions, std::vector<Driver> *drivers);

// The 32-bit x86 kernel object inside `kernel` (a kernel object or a fat
// file) with one more segment command: the drivers' segment, at the first
// page boundary above the highest segment, its data at the file's end.
// Returns an empty string, else what is wrong with the kernel.
std::string AddPrelinkSegment(const std::vector<uint8_t> &kernel, const std::vector<Driver> &drivers,
                              std::vector<uint8_t> *object, uint32_t *segmentAddress = nullptr);

}  // namespace kcache
