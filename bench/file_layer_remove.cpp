// Recursive removal of a tree: QSFileManager::removeItemAtURL against
// coreutils `rm -rf` on the same kind of tree (one process start included).
// Arguments: directories, files per directory.
#include <benchmark/benchmark.h>

#include "BenchTree.h"
#include "Shared/FileManager/QSFileManager.h"

namespace {

template <class Remove>
void removeTrees(benchmark::State& state, const Remove& remove) {
  const std::string scratch = qsbench::makeScratchDirectory(qsbench::temporaryDirectory(), "qs-bench-remove");
  const std::string tree = scratch + "/tree";
  const int directories = static_cast<int>(state.range(0));
  const int files = static_cast<int>(state.range(1));
  for (auto _ : state) {
    state.PauseTiming();
    if (!qsbench::buildTree(tree, directories, files, 0)) {
      state.SkipWithError("could not build the tree");
      break;
    }
    state.ResumeTiming();
    if (!remove(tree)) {
      state.SkipWithError("removal failed");
      break;
    }
  }
  state.SetItemsProcessed(state.iterations() * directories * (files + 1));
  qsbench::runCommand("rm -rf '" + scratch + "'");
}

void BM_RemoveItemAtURL(benchmark::State& state) {
  removeTrees(state, [](const std::string& tree) {
    return QSFileManager::defaultManager().removeItemAtURL(platform::URL::fileURL(tree, true));
  });
}

void BM_CoreutilsRmRf(benchmark::State& state) {
  removeTrees(state, [](const std::string& tree) { return qsbench::runCommand("rm -rf '" + tree + "'"); });
}

}  // namespace

BENCHMARK(BM_RemoveItemAtURL)->Args({10, 100})->Args({100, 100})->Iterations(5)->UseRealTime()->Unit(benchmark::kMillisecond);
BENCHMARK(BM_CoreutilsRmRf)->Args({10, 100})->Args({100, 100})->Iterations(5)->UseRealTime()->Unit(benchmark::kMillisecond);
BENCHMARK_MAIN();
