// kcache: writes a kernel cache file that the loader takes instead of the
// plain kernel and its drivers, under the name it looks for, with the time
// it requires.
#include <sys/stat.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <exception>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <memory>
#include <string>
#include <system_error>
#include <vector>

#include "boot/boot.h"
#include "hostfw/hostfw.h"
#include "kcache/cache_writer.h"
#include "kcache/prelink.h"
#include "memory/tracking.h"

namespace {

namespace fs = std::filesystem;

constexpr int kExitInput = 1;  // an input cannot be read or used, or the output not written
constexpr int kExitUsage = 2;  // the command line is wrong

const char kUsage[] =
    "Usage: kcache [options] KERNEL (-o FILE | --volume DIR)\n"
    "\n"
    "Writes a kernel cache: KERNEL (a kernel object or a fat file) compressed with\n"
    "LZSS behind the cache header, named by the checksum of the machine's model, the\n"
    "boot device path and the kernel's name, as the loader looks for it. Prints that\n"
    "name. Sets the file's time to one second after the newer of KERNEL and the\n"
    "extensions directory (with the newer one's nanoseconds): the loader takes a\n"
    "cache only then.\n"
    "\n"
    "Options:\n"
    "      --model TEXT          the machine's model name (required)\n"
    "      --boot-path-hex HEX   the boot device path's bytes in hex, end node\n"
    "                            included (required: it names the file)\n"
    "      --kernel-name NAME    the kernel's name as the loader opens it\n"
    "                            (default nimb_kernel)\n"
    "      --no-match-fields     leave the header's model and boot path zero, so that\n"
    "                            the loader compares neither\n"
    "      --uncompressed        write the kernel as it stands, with no header\n"
    "      --drivers DIR         put the driver bundles of the extensions directory\n"
    "                            DIR that a boot would load into the kernel, as one\n"
    "                            more segment on the page behind its image (a fat\n"
    "                            KERNEL gives its 32-bit x86 object alone)\n"
    "      --extensions DIR      the extensions directory whose time counts (default\n"
    "                            DIR/System/Library/Extensions with --volume, else\n"
    "                            only KERNEL's time counts)\n"
    "  -o, --output FILE         write the cache to FILE\n"
    "      --volume DIR          write it to DIR under the name the loader looks for\n"
    "  -h, --help                show this text\n"
    "\n"
    "Exit status: 0 on success, 1 when an input cannot be used or the output not\n"
    "written, 2 for a wrong command line.\n";

struct Options {
  std::string kernel, output, volume, model, kernelName = "nimb_kernel", drivers, extensions;
  std::vector<uint8_t> bootPath;
  bool haveModel = false, haveBootPath = false, matchFields = true, compressed = true;
};

[[noreturn]] void UsageError(const std::string &message) {
  std::fprintf(stderr, "kcache: %s\nTry 'kcache --help'.\n", message.c_str());
  std::exit(kExitUsage);
}

[[noreturn]] void InputError(const std::string &message) {
  std::fprintf(stderr, "kcache: %s\n", message.c_str());
  std::exit(kExitInput);
}

bool ParseHex(const std::string &text, std::vector<uint8_t> *bytes) {
  std::string digits;
  for (char c : text) {
    if (c == ' ' || c == ':' || c == '-') {
      continue;
    }
    if (!std::isxdigit(static_cast<unsigned char>(c))) {
      return false;
    }
    digits += c;
  }
  if (digits.empty() || digits.size() % 2 != 0) {
    return false;
  }
  for (size_t i = 0; i < digits.size(); i += 2) {
    bytes->push_back(static_cast<uint8_t>(std::stoul(digits.substr(i, 2), nullptr, 16)));
  }
  return true;
}

Options ParseOptions(int argc, char **argv) {
  Options options;
  for (int i = 1; i < argc; i++) {
    const std::string arg = argv[i];
    auto value = [&]() -> std::string {
      if (i + 1 >= argc) {
        UsageError(arg + " needs a value");
      }
      return argv[++i];
    };
    if (arg == "-h" || arg == "--help") {
      std::fputs(kUsage, stdout);
      std::exit(0);
    } else if (arg == "-o" || arg == "--output") {
      options.output = value();
    } else if (arg == "--volume") {
      options.volume = value();
    } else if (arg == "--model") {
      options.model = value();
      options.haveModel = true;
    } else if (arg == "--boot-path-hex") {
      const std::string hex = value();
      if (!ParseHex(hex, &options.bootPath)) {
        UsageError("--boot-path-hex " + hex + ": not an even number of hex digits");
      }
      options.haveBootPath = true;
    } else if (arg == "--kernel-name") {
      options.kernelName = value();
    } else if (arg == "--no-match-fields") {
      options.matchFields = false;
    } else if (arg == "--uncompressed") {
      options.compressed = false;
    } else if (arg == "--drivers") {
      options.drivers = value();
    } else if (arg == "--extensions") {
      options.extensions = value();
    } else if (arg.size() > 1 && arg[0] == '-') {
      UsageError("unknown option " + arg);
    } else if (options.kernel.empty()) {
      options.kernel = arg;
    } else {
      UsageError("more than one kernel: " + options.kernel + " and " + arg);
    }
  }
  if (options.kernel.empty()) {
    UsageError("no kernel given");
  }
  if (options.output.empty() == options.volume.empty()) {
    UsageError("give either -o FILE or --volume DIR");
  }
  if (!options.haveModel) {
    UsageError("no --model given");
  }
  if (!options.haveBootPath) {
    UsageError("no --boot-path-hex given");
  }
  if (options.model.empty()) {
    UsageError("--model is empty");
  }
  if (options.kernelName.empty()) {
    UsageError("--kernel-name is empty");
  }
  const std::string problem = kcache::CheckDevicePath(options.bootPath);
  if (!problem.empty()) {
    UsageError("--boot-path-hex: " + problem);
  }
  if (options.extensions.empty() && !options.volume.empty()) {
    options.extensions = (fs::path(options.volume) / "System/Library/Extensions").string();
  }
  return options;
}

std::vector<uint8_t> ReadInput(const std::string &path) {
  std::error_code error;
  if (!fs::exists(path, error)) {
    InputError(path + ": no such file");
  }
  if (!fs::is_regular_file(path, error)) {
    InputError(path + ": not a regular file");
  }
  std::ifstream in(path, std::ios::binary);
  std::vector<uint8_t> bytes((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
  if (!in.good() && !in.eof()) {
    InputError(path + ": cannot be read");
  }
  return bytes;
}

// The driver bundles, found and read with the loader's own property list
// parser, which runs on a host firmware of its own.
std::vector<kcache::Driver> ReadDrivers(const std::string &directory) {
  hostfw::Firmware fw;
  fw.SetConOutPresent(false);
  nimb::gST = fw.SystemTable();
  nimb::gBS = fw.BootServices();
  nimb::gRT = fw.RuntimeServices();
  nimb::gImageHandle = fw.ImageHandle();
  std::vector<kcache::Driver> drivers;
  const std::string problem = kcache::CollectDrivers(directory, &drivers);
  nimb::TrackedFreeAll();
  nimb::gST = nullptr;
  nimb::gBS = nullptr;
  nimb::gRT = nullptr;
  nimb::gImageHandle = nullptr;
  if (!problem.empty()) {
    InputError("--drivers " + problem);
  }
  return drivers;
}

int Run(int argc, char **argv) {
  const Options options = ParseOptions(argc, argv);
  std::vector<uint8_t> kernel = ReadInput(options.kernel);
  std::error_code error;
  if (!options.volume.empty() && !fs::is_directory(options.volume, error)) {
    InputError(options.volume + ": no such directory");
  }
  if (!options.extensions.empty() && !fs::is_directory(options.extensions, error)) {
    InputError(options.extensions + ": no such directory (the loader takes a cache only beside one)");
  }

  if (!options.drivers.empty()) {
    const std::vector<kcache::Driver> drivers = ReadDrivers(options.drivers);
    std::vector<uint8_t> object;
    const std::string problem = kcache::AddPrelinkSegment(kernel, drivers, &object);
    if (!problem.empty()) {
      InputError(options.kernel + ": " + problem);
    }
    kernel = std::move(object);
    std::fprintf(stderr, "kcache: %zu driver%s prelinked\n", drivers.size(), drivers.size() == 1 ? "" : "s");
  }
  if (!options.compressed && kernel.size() < nimb::kCacheHeaderBytes) {
    InputError(options.kernel +
               ": under 384 bytes, too short for a cache without header (the loader reads a " +
               "header's worth first)");
  }
  if (kernel.size() > 0xFFFFFFFFull - 4096) {
    InputError(options.kernel + ": too large for a cache");
  }

  const kcache::CacheKey key = kcache::MakeCacheKey(options.model, options.bootPath, options.kernelName);
  const std::string name = kcache::CacheFileName(key);
  const std::vector<uint8_t> file =
      options.compressed ? kcache::WriteCache(kernel, key, options.matchFields) : kernel;

  const fs::path output = options.output.empty() ? fs::path(options.volume) / name : fs::path(options.output);
  if (!options.volume.empty()) {
    fs::create_directories(output.parent_path(), error);
  }
  if (fs::is_directory(output, error)) {
    InputError(output.string() + ": is a directory");
  }
  {
    std::ofstream out(output, std::ios::binary | std::ios::trunc);
    out.write(reinterpret_cast<const char *>(file.data()), static_cast<std::streamsize>(file.size()));
    if (!out) {
      InputError(output.string() + ": cannot be written");
    }
  }
  const std::string problem = kcache::SetCacheTime(output.string(), options.kernel, options.extensions);
  if (!problem.empty()) {
    InputError(problem);
  }
  std::string loaderName = name;
  for (char &c : loaderName) {
    c = c == '/' ? '\\' : c;
  }
  std::printf("%s\n", loaderName.c_str());
  return 0;
}

}  // namespace

int main(int argc, char **argv) {
  try {
    return Run(argc, argv);
  } catch (const std::exception &e) {
    std::fprintf(stderr, "kcache: %s\n", e.what());
    return kExitInput;
  }
}
