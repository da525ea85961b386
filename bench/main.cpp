// The loader's Adler-32, MD5, memcpy and memcmp next to zlib, OpenSSL and the
// C library, on the same data in the same run. Each routine is first checked
// against its peer on every size; a routine that disagrees is not measured.
#include <benchmark/benchmark.h>
#include <openssl/evp.h>
#include <zlib.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <map>
#include <string>
#include <vector>

#include "figures.h"
#include "routines.h"

namespace {

// Sizes that a boot loader meets: a page, a file header's neighbourhood of
// a driver, a kernel.
constexpr size_t kSizes[] = {4 << 10, 64 << 10, 4 << 20};
constexpr size_t kLargest = 4 << 20;

using AdlerFunction = uint32_t (*)(const uint8_t *, size_t);
using Md5Function = void (*)(const uint8_t *, size_t, uint8_t *);
using MemcpyFunction = void *(*)(void *, const void *, size_t);
using MemcmpFunction = int (*)(const void *, const void *, size_t);

template <typename Function>
struct Contender {
  const char *name;
  Function function;
};

// Pseudo-random bytes, the same in every run. Two copies in buffers of their
// own, both 8-byte aligned, so that memcmp compares equal buffers word-wise.
struct Data {
  std::vector<uint8_t> bytes, copy, destination;
  Data() : bytes(kLargest), destination(kLargest) {
    uint64_t state = 0x9E3779B97F4A7C15ull;
    for (uint8_t &byte : bytes) {
      state ^= state << 13;
      state ^= state >> 7;
      state ^= state << 17;
      byte = static_cast<uint8_t>(state >> 24);
    }
    copy = bytes;
  }
};

Data &TheData() {
  static Data data;
  return data;
}

// --- the peers -----------------------------------------------------------------------

uint32_t ZlibAdler32(const uint8_t *data, size_t length) {
  return static_cast<uint32_t>(adler32_z(adler32_z(0, nullptr, 0), data, length));
}

void OpensslMd5(const uint8_t *data, size_t length, uint8_t digest[16]) {
  // The algorithm is fetched once, as a program that hashes often would.
  static EVP_MD *md5 = EVP_MD_fetch(nullptr, "MD5", nullptr);
  static EVP_MD_CTX *context = EVP_MD_CTX_new();
  unsigned int size = 0;
  if (md5 == nullptr || context == nullptr || !EVP_DigestInit_ex(context, md5, nullptr) ||
      !EVP_DigestUpdate(context, data, length) || !EVP_DigestFinal_ex(context, digest, &size) || size != 16) {
    std::fprintf(stderr, "nimb_bench: OpenSSL's MD5 failed\n");
    std::abort();
  }
}

void *LibcMemcpy(void *destination, const void *source, size_t count) {
  return std::memcpy(destination, source, count);
}

int LibcMemcmp(const void *a, const void *b, size_t count) {
  return std::memcmp(a, b, count);
}

int Sign(int value) {
  return (value > 0) - (value < 0);
}

// --- agreement before measurement ----------------------------------------------------------

bool Agree(const char *routine, const char *name, size_t size, bool same) {
  if (!same) {
    std::fprintf(stderr, "nimb_bench: %s of %s disagrees with its peer on %zu bytes\n", routine, name, size);
  }
  return same;
}

template <size_t N>
bool CheckAll(const Contender<AdlerFunction> (&adlers)[N], const Contender<Md5Function> (&md5s)[N],
              const Contender<MemcpyFunction> (&memcpys)[N], const Contender<MemcmpFunction> (&memcmps)[N]) {
  Data &d = TheData();
  bool ok = true;
  for (size_t size : kSizes) {
    // The peer is the last entry of each table.
    const uint32_t adler = adlers[N - 1].function(d.bytes.data(), size);
    uint8_t digest[16];
    md5s[N - 1].function(d.bytes.data(), size, digest);
    for (size_t i = 0; i + 1 < N; i++) {
      ok &= Agree("Adler32", adlers[i].name, size, adlers[i].function(d.bytes.data(), size) == adler);
      uint8_t mine[16];
      md5s[i].function(d.bytes.data(), size, mine);
      ok &= Agree("MD5", md5s[i].name, size, std::memcmp(mine, digest, 16) == 0);
      std::memset(d.destination.data(), 0, size);
      memcpys[i].function(d.destination.data(), d.bytes.data(), size);
      ok &= Agree("memcpy", memcpys[i].name, size,
                  std::memcmp(d.destination.data(), d.bytes.data(), size) == 0);
      // Equal, then unequal in the last byte both ways round. The loader reads
      // bytes as signed, the C library as unsigned: a low bit keeps the two
      // orders the same.
      ok &= Agree("memcmp", memcmps[i].name, size,
                  memcmps[i].function(d.bytes.data(), d.copy.data(), size) == 0);
      d.copy[size - 1] ^= 0x01;
      const int want = Sign(std::memcmp(d.bytes.data(), d.copy.data(), size));
      ok &= Agree("memcmp", memcmps[i].name, size,
                  Sign(memcmps[i].function(d.bytes.data(), d.copy.data(), size)) == want &&
                      Sign(memcmps[i].function(d.copy.data(), d.bytes.data(), size)) == -want);
      d.copy[size - 1] ^= 0x01;
    }
  }
  return ok;
}

// --- the measurements ---------------------------------------------------------------------

std::string Name(const char *routine, const char *contender, size_t size) {
  return std::string(routine) + "/" + contender + "/" + std::to_string(size);
}

// One benchmark for each size and contender; `body(function, size)` is one
// pass over `size` bytes.
template <typename Function, size_t N, typename Body>
void Register(const char *routine, const Contender<Function> (&contenders)[N], Body body) {
  for (size_t size : kSizes) {
    for (const Contender<Function> &c : contenders) {
      benchmark::RegisterBenchmark(
          Name(routine, c.name, size).c_str(), [c, size, body](benchmark::State &state) {
            for (auto _ : state) {
              body(c.function, size);
            }
            state.SetBytesProcessed(static_cast<int64_t>(state.iterations()) * static_cast<int64_t>(size));
          });
    }
  }
}

// --- the summary figures ----------------------------------------------------------------

// Google Benchmark's console table, and the rate of every run kept by
// benchmark name (the median over repetitions).
class FigureReporter : public benchmark::ConsoleReporter {
 public:
  void ReportRuns(const std::vector<Run> &runs) override {
    ConsoleReporter::ReportRuns(runs);
    for (const Run &run : runs) {
      // Single runs, or the medians where only aggregates are reported.
      const bool median = run.run_type == Run::RT_Aggregate && run.aggregate_name == "median";
      if ((run.run_type != Run::RT_Iteration && !median) || run.error_occurred) {
        continue;
      }
      const auto found = run.counters.find("bytes_per_second");
      if (found != run.counters.end()) {
        (median ? medians_ : rates_)[run.run_name.str()].push_back(found->second.value);
      }
    }
  }

  // The median rate of a benchmark, or a negative number when it did not run.
  double Rate(const std::string &name) const {
    auto found = rates_.find(name);
    if (found == rates_.end() || found->second.empty()) {
      found = medians_.find(name);
      if (found == medians_.end() || found->second.empty()) {
        return -1;
      }
    }
    std::vector<double> values = found->second;
    std::sort(values.begin(), values.end());
    return values[values.size() / 2];
  }

 private:
  std::map<std::string, std::vector<double>> rates_, medians_;
};

std::string RateText(double rate) {
  const char *units[] = {"B/s", "KiB/s", "MiB/s", "GiB/s"};
  int unit = 0;
  while (rate >= 1024 && unit < 3) {
    rate /= 1024;
    unit++;
  }
  char text[64];
  std::snprintf(text, sizeof text, "%.3g %s", rate, units[unit]);
  return text;
}

// One line per figure whose two benchmarks both ran (a filter may leave some out).
void PrintFigures(const FigureReporter &reporter) {
  // The table's last line may end in a colour code: the figures start on
  // lines of their own.
  std::printf("\n");
  for (const Figure &figure : Figures()) {
    const double loader = reporter.Rate(figure.loader), peer = reporter.Rate(figure.peer);
    if (loader <= 0 || peer <= 0) {
      continue;
    }
    std::printf("figure %s: %s vs %s = %.2fx\n", figure.name.c_str(), RateText(loader).c_str(),
                RateText(peer).c_str(), loader / peer);
  }
}

}  // namespace

int main(int argc, char **argv) {
  const Contender<AdlerFunction> adlers[] = {{"loader", gLoaderHostBuild.adler32},
                                             {"loader-fwflags", gLoaderFirmwareBuild.adler32},
                                             {"zlib", ZlibAdler32}};
  const Contender<Md5Function> md5s[] = {{"loader", gLoaderHostBuild.md5},
                                         {"loader-fwflags", gLoaderFirmwareBuild.md5},
                                         {"openssl", OpensslMd5}};
  const Contender<MemcpyFunction> memcpys[] = {{"loader", gLoaderHostBuild.memcpy},
                                               {"loader-fwflags", gLoaderFirmwareBuild.memcpy},
                                               {"libc", LibcMemcpy}};
  const Contender<MemcmpFunction> memcmps[] = {{"loader", gLoaderHostBuild.memcmp},
                                               {"loader-fwflags", gLoaderFirmwareBuild.memcmp},
                                               {"libc", LibcMemcmp}};
  if (!CheckAll(adlers, md5s, memcpys, memcmps) || !SetUpSuites()) {
    return 1;
  }

  Data &d = TheData();
  Register("Adler32", adlers,
           [&d](AdlerFunction f, size_t size) { benchmark::DoNotOptimize(f(d.bytes.data(), size)); });
  Register("MD5", md5s, [&d](Md5Function f, size_t size) {
    uint8_t digest[16];
    f(d.bytes.data(), size, digest);
    benchmark::DoNotOptimize(digest);
  });
  Register("memcpy", memcpys, [&d](MemcpyFunction f, size_t size) {
    benchmark::DoNotOptimize(f(d.destination.data(), d.bytes.data(), size));
    benchmark::ClobberMemory();
  });
  // Equal buffers: the whole length is read, as when a header matches.
  Register("memcmp", memcmps, [&d](MemcmpFunction f, size_t size) {
    benchmark::DoNotOptimize(f(d.bytes.data(), d.copy.data(), size));
  });
  // The figures: the firmware build's code on the largest size.
  const std::string largest = std::to_string(kLargest);
  AddFigure("adler32-vs-zlib", "Adler32/loader-fwflags/" + largest, "Adler32/zlib/" + largest);
  AddFigure("md5-vs-openssl", "MD5/loader-fwflags/" + largest, "MD5/openssl/" + largest);
  benchmark::Initialize(&argc, argv);
  if (benchmark::ReportUnrecognizedArguments(argc, argv)) {
    return 2;
  }
  FigureReporter reporter;
  benchmark::RunSpecifiedBenchmarks(&reporter);
  std::fflush(stdout);
  PrintFigures(reporter);
  benchmark::Shutdown();
  return 0;
}
