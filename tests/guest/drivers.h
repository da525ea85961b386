// What the kernel received of drivers. A plain boot hands over staged
// driver blocks ("Driver-%lx" ranges of /chosen/memory-map) or a driver
// package ("DriversPackage-%qx"); a boot from a kernel cache made with
// prelinked drivers brings them in one more segment of the kernel itself,
// on the first page boundary above the kernel's own image.
//
// Report lines:
//   kernel: driver "<identifier>" from=loader|cache address=0x.. plist=0x.. code=0x.. sum=0x..
//   kernel: package address=0x.. length=0x.. sum=0x..
//   kernel: drivers from=loader|cache|none blocks=<n> package=0|1
// `plist` is the length of the text with its zero, `code` the code's length,
// `sum` the standard Adler-32 of the code (or of the package).
#pragma once

#include <stdint.h>

#include "checks.h"

namespace nimb::guest {

// The standard Adler-32 of `length` bytes.
uint32_t Adler32(const uint8_t *data, uint32_t length);

// The identifier in a driver's property list text: the string that follows
// the key VzBundleIdentifier, up to `capacity` - 1 bytes; "?" when there is
// none.
void DriverIdentifier(const char *text, uint32_t length, char *out, uint32_t capacity);

// Reports and checks the drivers: the ranges among `areas` [first, count),
// and a prelinked segment at `imageEnd` rounded up to a page, inside the
// kernel region.
void CheckDrivers(const KernelRegion &region, uint32_t imageEnd, const Area *areas, uint32_t first,
                  uint32_t count);

}  // namespace nimb::guest
