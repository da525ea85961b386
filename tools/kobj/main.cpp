// kobj: turns a 32-bit x86 ELF executable into a kernel object that the
// loader places at its addresses, alone or wrapped in a fat file; `kobj fat`
// wraps any files (a driver package, a driver's code) into a fat file.
#include <sys/stat.h>

#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <string>
#include <vector>

#include "kobj/writer.h"
#include "load/kernel.h"
#include "load/kernel_format.h"

namespace {

constexpr int kExitInput = 1;  // the input cannot be made into a kernel object
constexpr int kExitUsage = 2;  // the command line is wrong

const char kUsage[] =
    "Usage: kobj [options] INPUT.elf -o OUTPUT\n"
    "\n"
    "Turns a 32-bit x86 ELF executable (clang --target=i386-unknown-none-elf, ld.lld\n"
    "--no-pie) into a kernel object: one segment per loadable program header, at its\n"
    "physical address (p_paddr), and the ELF entry point as the kernel's entry.\n"
    "Segments must start on 4096-byte boundaries and have pages of their own.\n"
    "\n"
    "Options:\n"
    "  -o, --output FILE         write the result to FILE (required)\n"
    "      --fat                 wrap the kernel object in a fat file\n"
    "      --big-endian          fat file with big-endian records (the default; implies --fat)\n"
    "      --little-endian       fat file with little-endian records (implies --fat)\n"
    "      --extra-slice TYPE:FILE\n"
    "                            add the bytes of FILE as a slice of processor type TYPE\n"
    "                            (decimal or 0x hex) in front of the kernel's slice;\n"
    "                            may be repeated, slices keep their order (implies --fat);\n"
    "                            not of the x86 type (7), which would hide the kernel\n"
    "      --append-slice TYPE:FILE\n"
    "                            the same, behind the kernel's slice\n"
    "  -v, --verbose             list the segments and the entry point\n"
    "  -h, --help                show this text\n"
    "\n"
    "Exit status: 0 on success, 1 when the input cannot be made into a kernel object,\n"
    "2 for a wrong command line.\n"
    "\n"
    "  kobj fat --help           wrapping any files into a fat file\n";

const char kFatUsage[] =
    "Usage: kobj fat [options] [X86-FILE] [--slice TYPE:FILE]... -o OUTPUT\n"
    "\n"
    "Wraps files as they stand (a driver package, a driver's code, a kernel object)\n"
    "into a fat file, one slice each, in the order given, each at a 4096-byte\n"
    "boundary. The loader takes the first 32-bit x86 slice of a fat file.\n"
    "\n"
    "Options:\n"
    "  -o, --output FILE         write the result to FILE (required)\n"
    "      --slice TYPE:FILE     a slice with the bytes of FILE for processor TYPE: x86\n"
    "                            (32-bit), x86_64, arm, arm64, ppc, or a number (decimal\n"
    "                            or 0x hex); may be repeated\n"
    "  X86-FILE                  the same as --slice x86:X86-FILE\n"
    "      --big-endian          big-endian records (the default)\n"
    "      --little-endian       little-endian records\n"
    "      --no-x86              allow a result without a 32-bit x86 slice\n"
    "  -h, --help                show this text\n"
    "\n"
    "A fat file without a 32-bit x86 slice is refused unless --no-x86 is given.\n"
    "Exit status: 0 on success, 1 when an input cannot be read or the result cannot be\n"
    "written, 2 for a wrong command line.\n";

struct ExtraSlice {
  uint32_t cpuType;
  std::string path;
  bool before;
};

struct Options {
  std::string input;
  std::string output;
  bool fat = false;
  bool orderGiven = false;
  kobj::ByteOrder order = kobj::ByteOrder::kBig;
  std::vector<ExtraSlice> extras;
  bool verbose = false;
};

[[noreturn]] void UsageError(const std::string &message) {
  std::fprintf(stderr, "kobj: %s\nTry 'kobj --help'.\n", message.c_str());
  std::exit(kExitUsage);
}

[[noreturn]] void InputError(const std::string &message) {
  std::fprintf(stderr, "kobj: %s\n", message.c_str());
  std::exit(kExitInput);
}

// The whole file; an input error naming the path when it cannot be read (a
// directory among them).
std::vector<uint8_t> ReadFile(const std::string &path) {
  struct stat info;
  if (stat(path.c_str(), &info) == 0 && S_ISDIR(info.st_mode))
    InputError("cannot read '" + path + "': it is a directory");
  std::FILE *file = std::fopen(path.c_str(), "rb");
  if (file == nullptr)
    InputError("cannot read '" + path + "': " + std::strerror(errno));
  std::vector<uint8_t> bytes;
  uint8_t buffer[65536];
  size_t got;
  while ((got = std::fread(buffer, 1, sizeof(buffer), file)) != 0)
    bytes.insert(bytes.end(), buffer, buffer + got);
  const bool failed = std::ferror(file) != 0;
  std::fclose(file);
  if (failed)
    InputError("cannot read '" + path + "'");
  return bytes;
}

ExtraSlice ParseSlice(const std::string &option, const std::string &value) {
  size_t colon = value.find(':');
  if (colon == std::string::npos || colon == 0 || colon + 1 == value.size())
    UsageError(option + " wants TYPE:FILE, not '" + value + "'");
  std::string type = value.substr(0, colon);
  static const struct {
    const char *name;
    uint32_t type;
  } kNamedTypes[] = {
      {"x86", nimb::kCpuTypeX86}, {"x86_64", 0x1000007}, {"arm", 12}, {"arm64", 0x100000C}, {"ppc", 18}};
  for (const auto &named : kNamedTypes) {
    if (type == named.name)
      return {named.type, value.substr(colon + 1), option == "--extra-slice"};
  }
  char *end = nullptr;
  errno = 0;
  unsigned long long number = std::strtoull(type.c_str(), &end, 0);
  if (*end != '\0' || errno != 0 || number > UINT32_MAX || type[0] == '-')
    UsageError(option + ": '" + type + "' is no 32-bit processor type");
  // The loader takes the first x86 slice: one in front would hide the kernel.
  if (number == nimb::kCpuTypeX86 && option == "--extra-slice")
    UsageError(option + ": a slice of the x86 type in front of the kernel's would hide it");
  return {static_cast<uint32_t>(number), value.substr(colon + 1), option == "--extra-slice"};
}

void SetOrder(Options *options, kobj::ByteOrder order) {
  if (options->orderGiven && options->order != order)
    UsageError("--big-endian and --little-endian exclude each other");
  options->orderGiven = true;
  options->order = order;
  options->fat = true;
}

// The value of the option `arg` that takes one: what follows '=' in the long
// form, or the next word (moving `*i` on).
std::string OptionValue(const std::string &arg, const std::string &name, int argc, char **argv, int *i) {
  if (arg.size() > name.size() && arg.compare(0, name.size() + 1, name + "=") == 0)
    return arg.substr(name.size() + 1);
  if (*i + 1 >= argc)
    UsageError(name + " needs a value");
  return argv[++*i];
}

Options ParseCommandLine(int argc, char **argv) {
  Options options;
  bool outputGiven = false;
  bool optionsEnded = false;
  for (int i = 1; i < argc; i++) {
    std::string arg = argv[i];
    auto value = [&](const std::string &name) { return OptionValue(arg, name, argc, argv, &i); };
    auto is = [&](const std::string &name) {
      return arg == name || (name.size() > 2 && arg.compare(0, name.size() + 1, name + "=") == 0);
    };
    if (optionsEnded || arg.empty() || arg[0] != '-' || arg == "-") {
      if (!options.input.empty())
        UsageError("one input file only ('" + options.input + "' and '" + arg + "')");
      options.input = arg;
    } else if (arg == "--") {
      optionsEnded = true;
    } else if (arg == "-h" || arg == "--help") {
      std::fputs(kUsage, stdout);
      std::exit(0);
    } else if (arg == "-o" || is("--output")) {
      if (outputGiven)
        UsageError("one output file only");
      outputGiven = true;
      options.output = value(arg == "-o" ? "-o" : "--output");
    } else if (arg == "--fat") {
      options.fat = true;
    } else if (arg == "--big-endian") {
      SetOrder(&options, kobj::ByteOrder::kBig);
    } else if (arg == "--little-endian") {
      SetOrder(&options, kobj::ByteOrder::kLittle);
    } else if (is("--extra-slice") || is("--append-slice")) {
      std::string name = arg.compare(0, 13, "--extra-slice") == 0 ? "--extra-slice" : "--append-slice";
      options.extras.push_back(ParseSlice(name, value(name)));
      options.fat = true;
    } else if (arg == "-v" || arg == "--verbose") {
      options.verbose = true;
    } else {
      UsageError("unknown option '" + arg + "'");
    }
  }
  if (options.input.empty())
    UsageError("no input file");
  if (options.output.empty())
    UsageError("no output file (-o OUTPUT)");
  return options;
}

void WriteOutput(const std::string &path, const std::vector<uint8_t> &out) {
  // Offsets in the records are 32-bit words.
  if (out.size() > UINT32_MAX)
    InputError("the result would exceed 4 GiB");
  std::ofstream file(path, std::ios::binary | std::ios::trunc);
  file.write(reinterpret_cast<const char *>(out.data()), static_cast<std::streamsize>(out.size()));
  file.close();
  if (!file)
    InputError("cannot write '" + path + "'");
}

kobj::FatEntry ReadSlice(const ExtraSlice &slice) {
  kobj::FatEntry entry;
  entry.cpuType = slice.cpuType;
  entry.cpuSubtype = slice.cpuType == nimb::kCpuTypeX86 ? kobj::kCpuSubtypeX86All : 0;
  entry.bytes = ReadFile(slice.path);
  return entry;
}

// kobj fat: the slices of the command line, in order, in one fat file.
int FatMain(int argc, char **argv) {
  std::vector<ExtraSlice> slices;
  std::string output;
  Options order;
  bool needX86 = true;
  for (int i = 2; i < argc; i++) {
    std::string arg = argv[i];
    auto value = [&](const std::string &name) { return OptionValue(arg, name, argc, argv, &i); };
    if (arg == "-h" || arg == "--help") {
      std::fputs(kFatUsage, stdout);
      return 0;
    } else if (arg == "-o" || arg.compare(0, 8, "--output") == 0) {
      if (!output.empty())
        UsageError("one output file only");
      output = value(arg == "-o" ? "-o" : "--output");
    } else if (arg.compare(0, 7, "--slice") == 0) {
      slices.push_back(ParseSlice("--slice", value("--slice")));
    } else if (arg == "--big-endian") {
      SetOrder(&order, kobj::ByteOrder::kBig);
    } else if (arg == "--little-endian") {
      SetOrder(&order, kobj::ByteOrder::kLittle);
    } else if (arg == "--no-x86") {
      needX86 = false;
    } else if (!arg.empty() && arg[0] == '-' && arg != "-") {
      UsageError("fat: unknown option '" + arg + "'");
    } else {
      slices.push_back({nimb::kCpuTypeX86, arg, false});
    }
  }
  if (slices.empty())
    UsageError("fat: no slices");
  if (output.empty())
    UsageError("fat: no output file (-o OUTPUT)");
  std::vector<kobj::FatEntry> entries;
  bool hasX86 = false;
  for (const ExtraSlice &slice : slices) {
    entries.push_back(ReadSlice(slice));
    hasX86 |= slice.cpuType == nimb::kCpuTypeX86;
    if (entries.back().bytes.empty())
      InputError("fat: '" + slice.path + "' is empty: the loader takes an empty slice for none");
  }
  if (needX86 && !hasX86)
    UsageError("fat: no 32-bit x86 slice, which is the one the loader takes (--no-x86 to make it anyway)");
  WriteOutput(output, kobj::WriteFat(entries, order.order));
  return 0;
}

}  // namespace

int main(int argc, char **argv) {
  if (argc > 1 && std::strcmp(argv[1], "fat") == 0)
    return FatMain(argc, argv);
  Options options = ParseCommandLine(argc, argv);

  const std::vector<uint8_t> elf = ReadFile(options.input);
  kobj::Kernel kernel;
  std::string problem = kobj::ReadElf(elf, &kernel);
  if (!problem.empty())
    InputError(options.input + ": " + problem);
  if (options.verbose) {
    for (const kobj::Segment &segment : kernel.segments) {
      std::fprintf(stderr, "segment at 0x%08x (placed at 0x%08x): 0x%x bytes in memory, 0x%zx in the file\n",
                   segment.address, segment.address & nimb::kKernelAddressMask, segment.memorySize,
                   segment.bytes.size());
    }
    std::fprintf(stderr, "entry 0x%08x (0x%08x)\n", kernel.entry, kernel.entry & nimb::kKernelAddressMask);
  }

  std::vector<uint8_t> out = kobj::WriteObject(kernel);
  if (options.fat) {
    std::vector<kobj::FatEntry> slices;
    std::vector<kobj::FatEntry> after;
    for (const ExtraSlice &extra : options.extras)
      (extra.before ? slices : after).push_back(ReadSlice(extra));
    kobj::FatEntry own;
    own.cpuType = nimb::kCpuTypeX86;
    own.cpuSubtype = kobj::kCpuSubtypeX86All;
    own.bytes = std::move(out);
    slices.push_back(std::move(own));
    slices.insert(slices.end(), after.begin(), after.end());
    out = kobj::WriteFat(slices, options.order);
  }
  WriteOutput(options.output, out);
  return 0;
}
