// What the loader's tests cannot see broken in the host firmware: that calls
// after ExitBootServices are caught.
#include "hostfw/hostfw.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

namespace {

using hostfw::Firmware;

TEST(HostfwExitBootServices, LaterBootTimeCallsAreViolations) {
  Firmware fw;
  EFI_SYSTEM_TABLE *st = fw.SystemTable();
  EFI_BOOT_SERVICES *bs = st->BootServices;
  EXPECT_EQ(bs->ExitBootServices(fw.ImageHandle(), fw.MapKey() + 1), EFI_INVALID_PARAMETER);
  ASSERT_EQ(bs->ExitBootServices(fw.ImageHandle(), fw.MapKey()), EFI_SUCCESS);
  void *block = nullptr;
  EXPECT_EQ(bs->AllocatePool(EfiLoaderData, 8, &block), EFI_UNSUPPORTED);
  EXPECT_EQ(st->ConOut->OutputString(st->ConOut, u"late"), EFI_UNSUPPORTED);
  EXPECT_EQ(fw.ViolationsAfterExit(), (std::vector<std::string>{"AllocatePool", "OutputString"}));
  EXPECT_TRUE(fw.ConOutCalls().empty());
}

}  // namespace
