// The kernel file of the volume as dryboot reads it on its own: where its
// segments lie, and, for a kernel the loader refused, the step that refused
// it, found by running the loader's own steps on the file once more.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

namespace dryboot {

struct KernelSegment {
  uint32_t address;  // as the loader places it (low 30 bits)
  uint32_t memorySize;
  uint32_t fileSize;
};

struct KernelImage {
  std::string path;  // empty when the volume holds no such file
  std::vector<uint8_t> bytes;
};

// The file named `name` (the loader's path, `\` as separator) in the volume
// directory or one of its three boot directories, as the loader looks.
KernelImage FindKernelImage(const std::string &volume, const std::string &name);

// The segment commands of the image's x86 object (each clipped to what the
// file holds); empty for an image that is no kernel object.
std::vector<KernelSegment> KernelSegments(const std::vector<uint8_t> &bytes);

// The step at which the loader's own code refuses the image, with the
// status it gives ("finding the x86 slice: EFI_LOAD_ERROR (0x...)"), or an
// empty text when it loads. Runs on a firmware of its own while it lasts.
std::string KernelLoadFailure(const std::vector<uint8_t> &bytes, std::string (*statusText)(uint64_t));

}  // namespace dryboot
