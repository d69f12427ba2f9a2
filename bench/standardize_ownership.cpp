// Standardising the owner, group and modes of a tree of 100,000 items.
//
// The tree is 1,000 directories of 99 files each plus its root, every item
// with a foreign owner and a non-standard mode, so that every item needs both
// changes. It is built under $QS_BENCH_DIR (else $TMPDIR, else /tmp), outside
// the timed region, fresh for every timed run of the first benchmark.
#include <fcntl.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <string>

#include <benchmark/benchmark.h>

#include "Shared/FileManager/QSFileManager.h"

namespace {

constexpr int kDirectories = 1000;
constexpr int kFilesPerDirectory = 99;
constexpr int64_t kItems = kDirectories * (kFilesPerDirectory + 1) + 1;
constexpr uid_t kForeignUID = 1234;
constexpr gid_t kForeignGID = 5678;
constexpr uint32_t kWantedUID = 33;
constexpr uint32_t kWantedGID = 33;
constexpr mode_t kForeignDirectoryMode = 0700;
constexpr mode_t kForeignFileMode = 0600;

std::string benchDirectory() {
  for (const char* name : {"QS_BENCH_DIR", "TMPDIR"}) {
    const char* value = std::getenv(name);
    if (value && *value) return value;
  }
  return "/tmp";
}

bool makeItem(const std::string& path, bool directory) {
  if (directory) {
    if (mkdir(path.c_str(), kForeignDirectoryMode) != 0) return false;
  } else {
    int fd = open(path.c_str(), O_CREAT | O_EXCL | O_WRONLY | O_CLOEXEC, kForeignFileMode);
    if (fd < 0) return false;
    close(fd);
  }
  // The modes are set explicitly so that the umask cannot make them standard.
  return chmod(path.c_str(), directory ? kForeignDirectoryMode : kForeignFileMode) == 0 &&
         lchown(path.c_str(), kForeignUID, kForeignGID) == 0;
}

bool buildTree(const std::string& root) {
  if (!makeItem(root, true)) return false;
  for (int d = 0; d < kDirectories; ++d) {
    std::string dir = root + "/d" + std::to_string(d);
    if (!makeItem(dir, true)) return false;
    for (int f = 0; f < kFilesPerDirectory; ++f) {
      if (!makeItem(dir + "/f" + std::to_string(f), false)) return false;
    }
  }
  return true;
}

// A scratch directory for the trees, removed at the end.
class Scratch {
 public:
  Scratch() {
    std::string tmpl = benchDirectory() + "/qs-bench-standardize.XXXXXX";
    if (mkdtemp(tmpl.data())) path_ = tmpl;
  }
  ~Scratch() {
    if (!path_.empty()) (void)QSFileManager::defaultManager().removeItemAtURL(platform::URL::fileURL(path_, true));
  }
  const std::string& path() const { return path_; }

 private:
  std::string path_;
};

void BM_StandardizeFreshTree(benchmark::State& state) {
  Scratch scratch;
  QSFileManager& fm = QSFileManager::defaultManager();
  const platform::URL root = platform::URL::fileURL(scratch.path() + "/tree", true);
  for (auto _ : state) {
    state.PauseTiming();
    (void)fm.removeItemAtURL(root);
    if (scratch.path().empty() || !buildTree(root.path())) {
      state.SkipWithError("could not build the tree");
      break;
    }
    state.ResumeTiming();
    if (!fm.standardizeOwnershipAtURL(root, kWantedUID, kWantedGID, true)) {
      state.SkipWithError("standardisation failed");
      break;
    }
  }
  state.SetItemsProcessed(state.iterations() * kItems);
}
BENCHMARK(BM_StandardizeFreshTree)->Unit(benchmark::kMillisecond)->Iterations(3)->UseRealTime();

// The same walk over a tree that is already standard: the cost of checking
// alone.
void BM_StandardizeStandardTree(benchmark::State& state) {
  Scratch scratch;
  QSFileManager& fm = QSFileManager::defaultManager();
  const platform::URL root = platform::URL::fileURL(scratch.path() + "/tree", true);
  if (scratch.path().empty() || !buildTree(root.path()) ||
      !fm.standardizeOwnershipAtURL(root, kWantedUID, kWantedGID, true)) {
    state.SkipWithError("could not build the tree");
    return;
  }
  for (auto _ : state) {
    if (!fm.standardizeOwnershipAtURL(root, kWantedUID, kWantedGID, true)) {
      state.SkipWithError("standardisation failed");
      break;
    }
  }
  state.SetItemsProcessed(state.iterations() * kItems);
}
BENCHMARK(BM_StandardizeStandardTree)->Unit(benchmark::kMillisecond)->Iterations(3)->UseRealTime();

}  // namespace

BENCHMARK_MAIN();
