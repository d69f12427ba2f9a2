// Recursive copy of a tree with its metadata: QSFileManager::copyItemAtURL
// against coreutils `cp -a` (one process start included), within the
// temporary directory's file system and from it to /dev/shm.
// Arguments: directories, files per directory, bytes per file.
#include <benchmark/benchmark.h>

#include "BenchTree.h"
#include "Shared/FileManager/QSFileManager.h"

namespace {

constexpr char kOtherFileSystem[] = "/dev/shm";

template <class Copy>
void copyTrees(benchmark::State& state, bool acrossFileSystems, const Copy& copy) {
  const std::string scratch = qsbench::makeScratchDirectory(qsbench::temporaryDirectory(), "qs-bench-copy");
  const std::string target = qsbench::makeScratchDirectory(acrossFileSystems ? kOtherFileSystem : scratch, "target");
  const std::string source = scratch + "/source";
  const std::string destination = target + "/copy";
  const int directories = static_cast<int>(state.range(0));
  const int files = static_cast<int>(state.range(1));
  const size_t bytes = static_cast<size_t>(state.range(2));
  if (!qsbench::buildTree(source, directories, files, bytes)) state.SkipWithError("could not build the tree");
  for (auto _ : state) {
    if (!copy(source, destination)) {
      state.SkipWithError("copy failed");
      break;
    }
    state.PauseTiming();
    qsbench::runCommand("rm -rf '" + destination + "'");
    state.ResumeTiming();
  }
  state.SetBytesProcessed(state.iterations() * directories * files * static_cast<int64_t>(bytes));
  qsbench::runCommand("rm -rf '" + target + "' '" + scratch + "'");
}

bool copyWithFileManager(const std::string& source, const std::string& destination) {
  return QSFileManager::defaultManager().copyItemAtURL(platform::URL::fileURL(source, true),
                                                       platform::URL::fileURL(destination, true));
}

bool copyWithCoreutils(const std::string& source, const std::string& destination) {
  return qsbench::runCommand("cp -a '" + source + "' '" + destination + "'");
}

void BM_CopyItemAtURL(benchmark::State& state) { copyTrees(state, false, copyWithFileManager); }
void BM_CoreutilsCpA(benchmark::State& state) { copyTrees(state, false, copyWithCoreutils); }
void BM_CopyItemAtURLToShm(benchmark::State& state) { copyTrees(state, true, copyWithFileManager); }
void BM_CoreutilsCpAToShm(benchmark::State& state) { copyTrees(state, true, copyWithCoreutils); }

void treeShapes(benchmark::internal::Benchmark* b) {
  b->Args({10, 100, 4096})->Args({4, 4, 16 << 20})->Iterations(5)->UseRealTime()->Unit(benchmark::kMillisecond);
}

}  // namespace

BENCHMARK(BM_CopyItemAtURL)->Apply(treeShapes);
BENCHMARK(BM_CoreutilsCpA)->Apply(treeShapes);
BENCHMARK(BM_CopyItemAtURLToShm)->Apply(treeShapes);
BENCHMARK(BM_CoreutilsCpAToShm)->Apply(treeShapes);
BENCHMARK_MAIN();
