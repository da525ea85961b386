#include "boot/bootinfo.h"

#include "boot/boot.h"
#include "config/boot_options.h"
#include "config/options.h"
#include "devicetree/devicetree.h"
#include "devicetree/volume_uuid.h"
#include "memory/kernel_region.h"
#include "memory/tracking.h"
#include "screen/console.h"
#include "support/devicepath.h"
#include "support/strings.h"
#include "support/text.h"

namespace nimb {

BootArgs *bootArgs;

static const char kAcpi[] = "ACPI";

// The root volume's UUID for the kernel, unless the options name a root
// device of their own: the configuration's text as it stands, else the
// volume's identity.
static void AddRootUuid(DeviceTreeNode *chosen, EFI_HANDLE device, const char *options) {
  const char *value = nullptr;
  UINT64 length = 0;
  if (!EFI_ERROR(GetOptionValue(options, "rd", &value, &length))) {
    return;
  }
  const char *text = GetConfigValue("Root UUID");
  char buffer[64];
  if (text == nullptr && !EFI_ERROR(GetVolumeUuid(device, sizeof(buffer), buffer))) {
    text = buffer;
  }
  if (text == nullptr) {
    printf("(no root UUID found for boot device)\n");
    return;
  }
  printf("\nroot device uuid is '%s'\n", text);
  DeviceTreeAddProperty(chosen, "boot-uuid", strlen(text) + 1, text, 1);
}

EFI_STATUS InitBootInfo(EFI_LOADED_IMAGE_PROTOCOL *loadedImage, const char *options) {
  if (options == nullptr) {
    options = "";
  }
  UINT64 size = sizeof(BootArgs);
  bootArgs = reinterpret_cast<BootArgs *>(AllocateKernelRegion(&size));
  if (bootArgs == nullptr) {
    Fatal("Couldn't allocate bootArgs\n");
  }
  bzero(bootArgs, sizeof(BootArgs));
  bootArgs->version = kBootArgsVersion;
  bootArgs->revision = kBootArgsRevision;
  bootArgs->firmwareBits = kFirmwareBits;

  DeviceTreeNode *root = DeviceTreeFindNode("/", 0);
  if (root == nullptr) {
    Fatal("Couldn't create root node");
  }
  DeviceTreeAddProperty(root, "compatible", sizeof(kAcpi), kAcpi, 0);
  DeviceTreeAddProperty(root, "model", sizeof(kAcpi), kAcpi, 0);

  DeviceTreeNode *chosen = DeviceTreeFindNode("/chosen", 1);
  if (chosen == nullptr) {
    Fatal("Couldn't create /chosen node");
  }
  gMemoryMapNode = DeviceTreeFindNode("/chosen/memory-map", 1);

  AddRootUuid(chosen, loadedImage->DeviceHandle, options);

  char *kernelName = gKernelName != nullptr ? UcsToUtf8Alloc(gKernelName) : nullptr;
  if (kernelName == nullptr) {
    Fatal("allocate kernel name");
  }
  DeviceTreeAddProperty(chosen, "boot-file", strlen(kernelName) + 1, kernelName, 1);
  TrackedFree(kernelName);

  // Firmware memory holds the path until the tree is flattened.
  DeviceTreeAddProperty(chosen, "boot-device-path", DevicePathSize(gBootDevicePath), gBootDevicePath, 0);
  return EFI_SUCCESS;
}

}  // namespace nimb
