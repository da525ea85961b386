// The kernel cache's LZSS decoder, in the firmware build's code generation,
// against zlib's inflate and against a textbook ring decoder, on the same
// image: 4 MiB of real x86 code, each compressed its own way (zlib at its
// default level, LZSS with the cache writer's encoder). Before anything is
// timed every decoder must give back the image exactly. The suite also
// prints the compression ratios of the encoder's two parses and of zlib.
#include <benchmark/benchmark.h>
#include <elf.h>
#include <zlib.h>

#include <cstdio>
#include <cstring>
#include <fstream>
#include <iterator>
#include <string>
#include <vector>

#include "figures.h"
#include "kcache/lzss_encoder.h"
#include "routines.h"

namespace {

// The image: the first 4 MiB of the code section of the machine's LLVM
// library, a large body of compiled x86-64 code that is the same in every run.
const char kCodeFile[] = "/usr/lib/x86_64-linux-gnu/libLLVM-14.so.1";
constexpr size_t kImageBytes = 4 << 20;

using Bytes = std::vector<uint8_t>;

Bytes ReadFile(const char *path) {
  std::ifstream in(path, std::ios::binary);
  return Bytes((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
}

// `size` bytes of the ELF file's .text section, or nothing.
Bytes CodeSection(const Bytes &elf, size_t size) {
  if (elf.size() < sizeof(Elf64_Ehdr) || std::memcmp(elf.data(), ELFMAG, SELFMAG) != 0)
    return {};
  Elf64_Ehdr header;
  std::memcpy(&header, elf.data(), sizeof header);
  auto section = [&](size_t index, Elf64_Shdr *out) {
    const size_t at = header.e_shoff + index * sizeof(Elf64_Shdr);
    if (at + sizeof(Elf64_Shdr) > elf.size())
      return false;
    std::memcpy(out, &elf[at], sizeof *out);
    return true;
  };
  Elf64_Shdr names;
  if (!section(header.e_shstrndx, &names))
    return {};
  for (size_t i = 0; i < header.e_shnum; i++) {
    Elf64_Shdr text;
    if (section(i, &text) && names.sh_offset + text.sh_name + 6 <= elf.size() &&
        std::memcmp(&elf[names.sh_offset + text.sh_name], ".text", 6) == 0 && text.sh_size >= size &&
        text.sh_offset + size <= elf.size())
      return Bytes(elf.begin() + text.sh_offset, elf.begin() + text.sh_offset + size);
  }
  return {};
}

struct Streams {
  Bytes image, lzss, greedy, zlib, out;
};

Streams &TheStreams() {
  static Streams streams;
  return streams;
}

Bytes Deflate(const Bytes &data) {
  uLongf size = compressBound(data.size());
  Bytes out(size);
  if (compress2(out.data(), &size, data.data(), data.size(), Z_DEFAULT_COMPRESSION) != Z_OK)
    return {};
  out.resize(size);
  return out;
}

// zlib's inflate over one stream, with its state made once and reset for
// each pass, as a loader would hold it.
size_t Inflate(const Bytes &stream, Bytes &out) {
  static z_stream z = [] {
    z_stream made = {};
    inflateInit(&made);
    return made;
  }();
  inflateReset(&z);
  z.next_in = const_cast<Bytef *>(stream.data());
  z.avail_in = static_cast<uInt>(stream.size());
  z.next_out = out.data();
  z.avail_out = static_cast<uInt>(out.size());
  if (inflate(&z, Z_FINISH) != Z_STREAM_END)
    return 0;
  return z.total_out;
}

void PrintRatios(const char *what, const Bytes &data, bool withZlib) {
  const size_t optimal = kcache::CompressLzss(data.data(), data.size()).size();
  const size_t greedy = kcache::CompressLzss(data.data(), data.size(), kcache::LzssParse::kGreedy).size();
  std::printf(
      "lzss ratio of %s (%zu bytes): optimal parse %zu (%.2f%%), greedy %zu (%.2f%%), optimal saves %.2f%%",
      what, data.size(), optimal, 100.0 * optimal / data.size(), greedy, 100.0 * greedy / data.size(),
      100.0 * (greedy - optimal) / greedy);
  if (withZlib) {
    const size_t zlib = Deflate(data).size();
    std::printf("; zlib %zu (%.2f%%)", zlib, 100.0 * zlib / data.size());
  }
  std::printf("\n");
}

bool SetUp() {
  Streams &s = TheStreams();
  s.image = CodeSection(ReadFile(kCodeFile), kImageBytes);
  if (s.image.empty()) {
    std::fprintf(stderr, "nimb_bench: no %zu bytes of code in %s; the LZSS benchmarks are left out\n",
                 kImageBytes, kCodeFile);
    return true;
  }
  s.lzss = kcache::CompressLzss(s.image.data(), s.image.size());
  s.zlib = Deflate(s.image);
  s.out.assign(s.image.size(), 0);
  struct Decoder {
    const char *name;
    size_t (*decode)(Streams &);
  };
  const Decoder decoders[] = {
      {"loader",
       [](Streams &t) {
         return size_t(gLoaderHostBuild.decompressLzss(t.out.data(), t.out.size(), t.lzss.data(),
                                                       uint32_t(t.lzss.size())));
       }},
      {"loader-fwflags",
       [](Streams &t) {
         return size_t(gLoaderFirmwareBuild.decompressLzss(t.out.data(), t.out.size(), t.lzss.data(),
                                                           uint32_t(t.lzss.size())));
       }},
      {"textbook-fwflags",
       [](Streams &t) {
         return size_t(TextbookLzss(t.out.data(), t.out.size(), t.lzss.data(), uint32_t(t.lzss.size())));
       }},
      {"zlib-inflate", [](Streams &t) { return Inflate(t.zlib, t.out); }},
  };
  for (const Decoder &d : decoders) {
    std::fill(s.out.begin(), s.out.end(), 0);
    if (d.decode(s) != s.image.size() || s.out != s.image) {
      std::fprintf(stderr, "nimb_bench: %s does not give the image back\n", d.name);
      return false;
    }
    benchmark::RegisterBenchmark((std::string("decompress/") + d.name).c_str(), [d](benchmark::State &state) {
      Streams &t = TheStreams();
      for (auto _ : state) {
        benchmark::DoNotOptimize(d.decode(t));
        benchmark::ClobberMemory();
      }
      state.SetBytesProcessed(static_cast<int64_t>(state.iterations()) *
                              static_cast<int64_t>(t.image.size()));
    });
  }
  AddFigure("lzss-vs-inflate", "decompress/loader-fwflags", "decompress/zlib-inflate");
  AddFigure("lzss-vs-textbook", "decompress/loader-fwflags", "decompress/textbook-fwflags");

  PrintRatios("the code", s.image, true);
  const Bytes kernel = ReadFile(NIMB_REFERENCE_KERNEL);
  if (!kernel.empty())
    PrintRatios("the reference kernel", kernel, true);
  return true;
}

const BenchSuite kSuite("lzss", SetUp);

}  // namespace
