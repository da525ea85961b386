// The loader's AES-CBC decryption against OpenSSL's EVP AES-CBC, in place
// on the same data:
//
//   loader-tables        the table path, firmware code generation
//   openssl-tables       OpenSSL with its AES-instruction and SSSE3 paths
//                        masked off through OPENSSL_ia32cap: its own table code
//   loader-tables-alternating  the table path again, pass for pass beside
//                        openssl-tables in the same process
//   loader-instructions  the AES-instructions path, firmware code generation
//   openssl              OpenSSL as it comes, with the AES instructions
//
// OpenSSL reads OPENSSL_ia32cap once, when it initialises, for the whole
// process. So the masked peer runs in a child: this program started again
// with the mask and NIMB_BENCH_AES_CHILD in its environment, which decrypts
// the same data for as many passes as Google Benchmark asks of the
// benchmark, one pass of masked OpenSSL and one of the loader's table path
// in turn, and reports the CPU time each side took and the hashes of their
// plaintexts. The benchmarks hand those times on as manual time, and the
// table figures set the two sides of the same child against each other:
// on a busy machine, runs at different moments meet different loads.
// OpenSSL 3 doesn't export its capability word, so that the mask took is
// seen from the rate: the suite warns when the masked child isn't far
// slower than OpenSSL here.
#include <benchmark/benchmark.h>
#include <openssl/evp.h>
#include <time.h>
#include <unistd.h>

#include <cinttypes>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "aes_routines.h"
#include "figures.h"

namespace {

constexpr size_t kBytes = 1 << 20;
// Clears AESNI (bit 57) and SSSE3 (bit 41) of OpenSSL's capability vector.
constexpr uint64_t kMaskedBits = (1ull << 57) | (1ull << 41);
constexpr const char *kChildVariable = "NIMB_BENCH_AES_CHILD";

struct Data {
  std::vector<uint8_t> cipher, work, key;
  uint8_t iv[16];
  Data() : cipher(kBytes), work(kBytes), key(32) {
    uint64_t state = 0xA0761D6478BD642Full;
    auto next = [&state] {
      state ^= state << 13;
      state ^= state >> 7;
      state ^= state << 17;
      return static_cast<uint8_t>(state >> 24);
    };
    for (uint8_t &b : cipher)
      b = next();
    for (uint8_t &b : key)
      b = next();
    for (uint8_t &b : iv)
      b = next();
  }
};

Data &TheData() {
  static Data data;
  return data;
}

uint64_t Fnv1a(const std::vector<uint8_t> &bytes) {
  uint64_t hash = 0xCBF29CE484222325ull;
  for (uint8_t b : bytes)
    hash = (hash ^ b) * 0x100000001B3ull;
  return hash;
}

double CpuSeconds() {
  timespec now;
  clock_gettime(CLOCK_PROCESS_CPUTIME_ID, &now);
  return static_cast<double>(now.tv_sec) + static_cast<double>(now.tv_nsec) * 1e-9;
}

// One in-place pass of OpenSSL over `bytes`, the algorithm fetched once.
void OpensslDecrypt(int bits, uint8_t *bytes, size_t length) {
  static EVP_CIPHER *ciphers[2] = {EVP_CIPHER_fetch(nullptr, "AES-128-CBC", nullptr),
                                   EVP_CIPHER_fetch(nullptr, "AES-256-CBC", nullptr)};
  static EVP_CIPHER_CTX *context = EVP_CIPHER_CTX_new();
  const Data &d = TheData();
  int out = 0;
  if (ciphers[bits == 256] == nullptr || context == nullptr ||
      !EVP_DecryptInit_ex2(context, ciphers[bits == 256], d.key.data(), d.iv, nullptr) ||
      !EVP_CIPHER_CTX_set_padding(context, 0) ||
      !EVP_DecryptUpdate(context, bytes, &out, bytes, static_cast<int>(length)) ||
      static_cast<size_t>(out) != length) {
    std::fprintf(stderr, "nimb_bench: OpenSSL's AES-%d-CBC failed\n", bits);
    std::abort();
  }
}

void LoaderDecrypt(int bits, uint8_t *bytes, size_t length) {
  alignas(16) uint8_t context[AesRoutines::kContextBytes];
  gAesFirmwareBuild.expand(TheData().key.data(), bits, context);
  gAesFirmwareBuild.decrypt(bytes, TheData().iv, static_cast<uint32_t>(length / 16), bytes, context);
}

// Plaintext hash of one pass from the ciphertext.
template <typename Decrypt>
uint64_t PlainHash(Decrypt decrypt, int bits) {
  Data &d = TheData();
  d.work = d.cipher;
  decrypt(bits, d.work.data(), kBytes);
  return Fnv1a(d.work);
}

// --- the masked child ---------------------------------------------------------------------

struct ChildReport {
  uint64_t hash = 0;        // OpenSSL's plaintext
  uint64_t loaderHash = 0;  // the loader's table path's plaintext
  double seconds = -1;      // OpenSSL's passes
  double loaderSeconds = -1;
};

// In the child: "BITS PASSES" from the environment. The passes alternate
// between masked OpenSSL and the loader's table path, one of each at a
// time, so that both meet the same load on the machine; each side's CPU
// time is summed over its own passes. Prints the report and leaves before
// main.
[[maybe_unused]] const bool gChild = [] {
  const char *request = std::getenv(kChildVariable);
  if (request == nullptr)
    return false;
  int bits = 0;
  long long passes = 0;
  if (std::sscanf(request, "%d %lld", &bits, &passes) != 2 || !gAesFirmwareBuild.usePath(false))
    _exit(2);
  const uint64_t loaderHash = PlainHash(LoaderDecrypt, bits);
  const uint64_t hash = PlainHash(OpensslDecrypt, bits);
  uint8_t *bytes = TheData().work.data();
  double seconds = 0, loaderSeconds = 0;
  for (long long i = 0; i < passes; i++) {
    double start = CpuSeconds();
    OpensslDecrypt(bits, bytes, kBytes);
    const double middle = CpuSeconds();
    LoaderDecrypt(bits, bytes, kBytes);
    const double end = CpuSeconds();
    seconds += middle - start;
    loaderSeconds += end - middle;
  }
  std::printf("%" PRIx64 " %" PRIx64 " %.9f %.9f\n", hash, loaderHash, seconds, loaderSeconds);
  std::fflush(stdout);
  _exit(0);
}();

ChildReport RunMaskedChild(int bits, long long passes) {
  char command[512];
  std::snprintf(command, sizeof command, "OPENSSL_ia32cap='~0x%" PRIx64 "' %s='%d %lld' /proc/%d/exe",
                kMaskedBits, kChildVariable, bits, passes, static_cast<int>(getpid()));
  ChildReport report;
  FILE *child = popen(command, "r");
  if (child == nullptr)
    return report;
  if (std::fscanf(child, "%" SCNx64 " %" SCNx64 " %lf %lf", &report.hash, &report.loaderHash, &report.seconds,
                  &report.loaderSeconds) != 4)
    report.seconds = -1;
  if (pclose(child) != 0)
    report.seconds = -1;
  return report;
}

// --- the benchmarks -----------------------------------------------------------------------

std::string Name(int bits, const char *contender) {
  return "AES" + std::to_string(bits) + "-CBC/" + contender + "/" + std::to_string(kBytes);
}

template <typename Decrypt>
void Register(int bits, const char *contender, Decrypt decrypt) {
  benchmark::RegisterBenchmark(Name(bits, contender).c_str(), [bits, decrypt](benchmark::State &state) {
    uint8_t *bytes = TheData().work.data();
    for (auto _ : state)
      decrypt(bits, bytes, kBytes);
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations()) * static_cast<int64_t>(kBytes));
  });
}

// The two sides of the masked child's alternating passes, each as a
// benchmark of its own with the child's time for its side.
void RegisterMasked(int bits, const char *contender, bool loader) {
  benchmark::RegisterBenchmark(Name(bits, contender).c_str(), [bits, loader](benchmark::State &state) {
    const ChildReport report = RunMaskedChild(bits, static_cast<long long>(state.max_iterations));
    if (report.seconds < 0) {
      state.SkipWithError("the masked child failed");
      return;
    }
    const double seconds = loader ? report.loaderSeconds : report.seconds;
    for (auto _ : state)
      state.SetIterationTime(seconds / static_cast<double>(state.max_iterations));
    state.SetBytesProcessed(static_cast<int64_t>(state.iterations()) * static_cast<int64_t>(kBytes));
  })->UseManualTime();
}

bool Agree(int bits, const char *contender, uint64_t hash, uint64_t want) {
  if (hash != want)
    std::fprintf(stderr, "nimb_bench: AES-%d-CBC of %s disagrees with OpenSSL\n", bits, contender);
  return hash == want;
}

// Every contender decrypts to OpenSSL's plaintext before anything is
// measured.
constexpr int kProbePasses = 4;
const BenchSuite gAesSuite("aes", [] {
  const bool instructions = gAesFirmwareBuild.usePath(true);
  bool ok = true;
  for (int bits : {128, 256}) {
    const uint64_t want = PlainHash(OpensslDecrypt, bits);
    gAesFirmwareBuild.usePath(false);
    ok &= Agree(bits, "loader-tables", PlainHash(LoaderDecrypt, bits), want);
    if (instructions) {
      gAesFirmwareBuild.usePath(true);
      ok &= Agree(bits, "loader-instructions", PlainHash(LoaderDecrypt, bits), want);
    }
    const ChildReport child = RunMaskedChild(bits, kProbePasses);
    ok &= child.seconds >= 0 && Agree(bits, "openssl-tables", child.hash, want) &&
          Agree(bits, "loader-tables beside it", child.loaderHash, want);
    const double start = CpuSeconds();
    for (int i = 0; i < kProbePasses; i++)
      OpensslDecrypt(bits, TheData().work.data(), kBytes);
    if (child.seconds < 3 * (CpuSeconds() - start))
      std::fprintf(stderr,
                   "nimb_bench: warning: masked OpenSSL runs AES-%d-CBC at more than a third of its "
                   "unmasked speed; did the mask take?\n",
                   bits);
  }
  if (!ok)
    return false;

  auto tables = [](int bits, uint8_t *bytes, size_t length) {
    gAesFirmwareBuild.usePath(false);
    LoaderDecrypt(bits, bytes, length);
  };
  auto withInstructions = [](int bits, uint8_t *bytes, size_t length) {
    gAesFirmwareBuild.usePath(true);
    LoaderDecrypt(bits, bytes, length);
  };
  for (int bits : {128, 256}) {
    Register(bits, "loader-tables", tables);
    RegisterMasked(bits, "loader-tables-alternating", true);
    RegisterMasked(bits, "openssl-tables", false);
    if (instructions)
      Register(bits, "loader-instructions", withInstructions);
    Register(bits, "openssl", OpensslDecrypt);
  }
  // Google Benchmark names a benchmark with manual time so.
  // The table figures come from the child's alternating passes: the two
  // sides met the same load.
  AddFigure("aes128-vs-openssl-tables", Name(128, "loader-tables-alternating") + "/manual_time",
            Name(128, "openssl-tables") + "/manual_time");
  AddFigure("aes256-vs-openssl-tables", Name(256, "loader-tables-alternating") + "/manual_time",
            Name(256, "openssl-tables") + "/manual_time");
  AddFigure("aes128-ni-vs-openssl", Name(128, "loader-instructions"), Name(128, "openssl"));
  return true;
});

}  // namespace
