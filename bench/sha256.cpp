// Throughput of QSCreateSHA256Digest over one file.
//
// The file is QS_BENCH_SHA256_FILE when set (compare_sha256.sh hands in the
// same file it gives sha256sum); otherwise a file of random bytes is made in
// the temporary directory for the run: QS_BENCH_SHA256_MIB mebibytes, 64 by
// default. When QS_BENCH_SHA256_EXPECTED is set, a digest that differs from
// it fails the run.
#include <benchmark/benchmark.h>

#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <random>
#include <string>
#include <vector>

#include "Shared/Support/QSUtilities.h"

namespace {

constexpr char kFileVariable[] = "QS_BENCH_SHA256_FILE";
constexpr char kSizeVariable[] = "QS_BENCH_SHA256_MIB";
constexpr char kExpectedVariable[] = "QS_BENCH_SHA256_EXPECTED";
constexpr long kDefaultMebibytes = 64;
constexpr size_t kMebibyte = 1024 * 1024;

// The file under measurement, made once; removed at exit when made here.
class BenchFile {
 public:
  BenchFile() {
    if (const char* given = std::getenv(kFileVariable); given && *given) {
      path_ = given;
      return;
    }
    const char* sizeText = std::getenv(kSizeVariable);
    long mebibytes = sizeText ? std::strtol(sizeText, nullptr, 10) : kDefaultMebibytes;
    const char* tmp = std::getenv("TMPDIR");
    path_ = std::string(tmp && *tmp ? tmp : "/tmp") + "/qs-bench-sha256.bin";
    std::ofstream out(path_, std::ios::binary | std::ios::trunc);
    std::mt19937_64 generator(42);
    std::vector<uint64_t> block(kMebibyte / sizeof(uint64_t));
    for (long i = 0; i < mebibytes; ++i) {
      for (uint64_t& word : block) word = generator();
      out.write(reinterpret_cast<const char*>(block.data()), static_cast<std::streamsize>(kMebibyte));
    }
    owned_ = true;
  }
  ~BenchFile() {
    if (owned_) std::remove(path_.c_str());
  }
  const std::string& path() const { return path_; }
  int64_t size() const {
    std::ifstream in(path_, std::ios::binary | std::ios::ate);
    return static_cast<int64_t>(in.tellg());
  }

 private:
  std::string path_;
  bool owned_ = false;
};

const BenchFile& benchFile() {
  static BenchFile file;
  return file;
}

void BM_SHA256File(benchmark::State& state) {
  const BenchFile& file = benchFile();
  const int64_t size = file.size();
  if (size <= 0) {
    state.SkipWithError("no file to digest");
    return;
  }
  const char* expected = std::getenv(kExpectedVariable);
  for (auto _ : state) {
    std::optional<std::string> digest = QSCreateSHA256Digest(file.path());
    if (!digest) {
      state.SkipWithError("digest failed");
      return;
    }
    if (expected && *expected && *digest != expected) {
      state.SkipWithError("digest differs from the expected one");
      return;
    }
    benchmark::DoNotOptimize(digest);
  }
  state.SetBytesProcessed(state.iterations() * size);
}
BENCHMARK(BM_SHA256File)->Unit(benchmark::kMillisecond)->UseRealTime();

}  // namespace

BENCHMARK_MAIN();
