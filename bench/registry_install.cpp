// The application registry: installing packages and looking records up.
//
// Each benchmark works in a fresh system root under $QS_BENCH_DIR (else
// $TMPDIR, else /tmp). Installation is timed from the call to its return,
// including the two durable transactions and the package's removal; building
// each package happens outside the timed region.
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <string>

#include <benchmark/benchmark.h>

#include "Platform/BundleReader.h"
#include "Platform/Registry/SQLiteRegistry.h"

namespace {

constexpr int kFilesPerBundle = 20;
constexpr int kLookupRecords = 500;
constexpr char kIdentifierPrefix[] = "com.example.bench.";

std::string benchDirectory() {
  for (const char* name : {"QS_BENCH_DIR", "TMPDIR"}) {
    const char* value = std::getenv(name);
    if (value && *value) return value;
  }
  return "/tmp";
}

std::string makeRoot() {
  std::string tmpl = benchDirectory() + "/qs-registry-bench.XXXXXX";
  return mkdtemp(tmpl.data()) ? tmpl : std::string();
}

void removeRoot(const std::string& root) {
  std::string command = "rm -rf '" + root + "'";
  if (std::system(command.c_str()) != 0) std::fprintf(stderr, "could not remove %s\n", root.c_str());
}

bool writeText(const std::string& path, const std::string& text) {
  std::ofstream out(path);
  out << text;
  return static_cast<bool>(out);
}

// A package holding one application of kFilesPerBundle files.
bool makePackage(const std::string& package, const std::string& identifier) {
  std::string bundle = package + "/Payload/App.app";
  for (const std::string& dir : {package, package + "/Payload", bundle}) {
    if (mkdir(dir.c_str(), 0755) != 0) return false;
  }
  std::string plist =
      "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\"><dict>"
      "<key>RkBundleIdentifier</key><string>" +
      identifier +
      "</string>"
      "<key>RkBundleVersion</key><string>1.0</string></dict></plist>\n";
  if (!writeText(bundle + "/Info.plist", plist)) return false;
  for (int i = 0; i < kFilesPerBundle; ++i) {
    if (!writeText(bundle + "/file" + std::to_string(i), std::string(1024, 'x'))) return false;
  }
  return writeText(package + "/VendraMetadata.plist", plist);
}

bool install(platform::SQLiteApplicationRegistry& registry, const std::string& package, const std::string& identifier) {
  platform::Dictionary options{{platform::kBundleIdentifierKey, platform::Value(identifier)}};
  return registry.installPackage(platform::URL::fileURL(package, true), options, {}, nullptr);
}

void BM_InstallPackage(benchmark::State& state) {
  std::string root = makeRoot();
  auto registry = platform::SQLiteApplicationRegistry::open(root);
  if (!registry) {
    state.SkipWithError("registry could not be opened");
    return;
  }
  int serial = 0;
  for (auto _ : state) {
    state.PauseTiming();
    std::string identifier = kIdentifierPrefix + std::to_string(serial % 50);
    std::string package = root + "/package" + std::to_string(serial++);
    bool made = makePackage(package, identifier);
    state.ResumeTiming();
    if (!made || !install(*registry, package, identifier)) {
      state.SkipWithError("installation failed");
      break;
    }
  }
  registry.reset();
  removeRoot(root);
}
BENCHMARK(BM_InstallPackage)->Unit(benchmark::kMillisecond);

void BM_RecordLookup(benchmark::State& state) {
  std::string root = makeRoot();
  auto registry = platform::SQLiteApplicationRegistry::open(root);
  for (int i = 0; registry && i < kLookupRecords; ++i) {
    std::string identifier = kIdentifierPrefix + std::to_string(i);
    std::string package = root + "/package" + std::to_string(i);
    if (!makePackage(package, identifier) || !install(*registry, package, identifier)) {
      registry.reset();
    }
  }
  if (!registry) {
    state.SkipWithError("setup failed");
    removeRoot(root);
    return;
  }
  int i = 0;
  for (auto _ : state) {
    benchmark::DoNotOptimize(registry->recordForIdentifier(kIdentifierPrefix + std::to_string(i++ % kLookupRecords)));
  }
  registry.reset();
  removeRoot(root);
}
BENCHMARK(BM_RecordLookup)->Unit(benchmark::kMicrosecond);

}  // namespace

BENCHMARK_MAIN();
