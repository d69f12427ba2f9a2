// Listing a large directory with urlsForItemsInDirectoryAtURL, against a
// bare readdir loop over the same directory (the floor).
// Argument: number of entries.
#include <dirent.h>

#include <benchmark/benchmark.h>

#include "BenchTree.h"
#include "Shared/FileManager/QSFileManager.h"

namespace {

struct ListedDirectory {
  std::string scratch, directory;
  explicit ListedDirectory(int entries) {
    scratch = qsbench::makeScratchDirectory(qsbench::temporaryDirectory(), "qs-bench-list");
    directory = scratch + "/tree/dir0";
    if (!qsbench::buildTree(scratch + "/tree", 1, entries, 0)) directory.clear();
  }
  ~ListedDirectory() { qsbench::runCommand("rm -rf '" + scratch + "'"); }
};

void BM_UrlsForItemsInDirectory(benchmark::State& state) {
  ListedDirectory listed(static_cast<int>(state.range(0)));
  if (listed.directory.empty()) state.SkipWithError("could not build the directory");
  const platform::URL url = platform::URL::fileURL(listed.directory, true);
  for (auto _ : state) {
    auto urls = QSFileManager::defaultManager().urlsForItemsInDirectoryAtURL(url, true);
    if (!urls || urls->size() != static_cast<size_t>(state.range(0))) {
      state.SkipWithError("listing failed");
      break;
    }
    benchmark::DoNotOptimize(urls);
  }
  state.SetItemsProcessed(state.iterations() * state.range(0));
}

void BM_BareReaddir(benchmark::State& state) {
  ListedDirectory listed(static_cast<int>(state.range(0)));
  if (listed.directory.empty()) state.SkipWithError("could not build the directory");
  for (auto _ : state) {
    DIR* dir = opendir(listed.directory.c_str());
    size_t count = 0;
    while (const dirent* entry = readdir(dir)) count += entry->d_name[0] != '.';
    closedir(dir);
    benchmark::DoNotOptimize(count);
  }
  state.SetItemsProcessed(state.iterations() * state.range(0));
}

}  // namespace

BENCHMARK(BM_UrlsForItemsInDirectory)->Arg(1000)->Arg(100000)->UseRealTime()->Unit(benchmark::kMicrosecond);
BENCHMARK(BM_BareReaddir)->Arg(1000)->Arg(100000)->UseRealTime()->Unit(benchmark::kMicrosecond);
BENCHMARK_MAIN();
