#include "tsc.h"

#include "serial.h"

namespace nimb::platform {

void ReportTsc(const char *moment, UINT64 tsc) {
  SerialPrintf("\nplatform: tsc %s=0x%x\n", moment, tsc);
}

}  // namespace nimb::platform
