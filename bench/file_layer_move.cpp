// Moves of a tree to another file system: QSFileManager::moveItemAtURL (a
// copy, then the removal of the source) against coreutils `cp -a` followed by
// `rm -rf` (two programs started directly, without a shell).
//
// Arguments: route, then shape.
//   route 0: tmpfs to tmpfs (/dev/shm to a tmpfs this program mounts; needs root)
//   route 1: ext4 to tmpfs ($TMPDIR, else /tmp, to /dev/shm)
//   shape 0: 10 directories x 100 files x 4 KiB
//   shape 1: 4 directories x 4 files x 16 MiB
//   shape 2: one 1 GiB file with two 4 KiB extents, holes elsewhere
// Every iteration moves a fresh tree, built and flushed (syncfs) outside the
// timed section, as data that has sat on its file system for a while is; the
// copy is removed outside the timed section too.
// bench/compare_move.sh runs both sides alternately and prints the ratios.
#include <fcntl.h>
#include <sched.h>
#include <spawn.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <benchmark/benchmark.h>

#include "BenchTree.h"
#include "Shared/FileManager/QSFileManager.h"

extern char** environ;

namespace {

constexpr char kSharedMemory[] = "/dev/shm";
constexpr char kSparseFileName[] = "sparse";
constexpr off_t kSparseFileSize = off_t{1} << 30;
constexpr off_t kSparseExtents[] = {0, kSparseFileSize / 2};
constexpr size_t kExtentSize = 4096;

struct Shape {
  int directories, files;
  size_t bytes;  // 0: the sparse file
};
constexpr Shape kShapes[] = {{10, 100, 4096}, {4, 4, 16 << 20}, {0, 0, 0}};

// The second tmpfs, mounted by main for the whole run.
std::string gPrivateTmpfs;

bool buildSparseFile(const std::string& root) {
  if (mkdir(root.c_str(), 0755) != 0) return false;
  int fd = open((root + "/" + kSparseFileName).c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0644);
  if (fd < 0) return false;
  const std::string block(kExtentSize, 'q');
  bool built = ftruncate(fd, kSparseFileSize) == 0;
  for (off_t at : kSparseExtents) built = built && pwrite(fd, block.data(), block.size(), at) == ssize_t(block.size());
  close(fd);
  return built;
}

// Builds the shape at `root` and flushes its file system.
bool buildShape(const std::string& root, const Shape& shape) {
  bool built =
      shape.bytes == 0 ? buildSparseFile(root) : qsbench::buildTree(root, shape.directories, shape.files, shape.bytes);
  int fd = open(root.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  built = built && fd >= 0 && syncfs(fd) == 0;
  if (fd >= 0) close(fd);
  return built;
}

bool runProgram(std::vector<std::string> arguments) {
  std::vector<char*> argv;
  for (std::string& argument : arguments) argv.push_back(argument.data());
  argv.push_back(nullptr);
  pid_t pid = 0;
  if (posix_spawnp(&pid, argv[0], nullptr, nullptr, argv.data(), environ) != 0) return false;
  int status = 0;
  return waitpid(pid, &status, 0) == pid && WIFEXITED(status) && WEXITSTATUS(status) == 0;
}

bool moveWithFileManager(const std::string& source, const std::string& destination) {
  return QSFileManager::defaultManager().moveItemAtURL(platform::URL::fileURL(source, true),
                                                       platform::URL::fileURL(destination, true));
}

bool moveWithCoreutils(const std::string& source, const std::string& destination) {
  return runProgram({"cp", "-a", source, destination}) && runProgram({"rm", "-rf", source});
}

template <class Move>
void moveTrees(benchmark::State& state, const Move& move) {
  const bool fromExt4 = state.range(0) == 1;
  const Shape& shape = kShapes[state.range(1)];
  if (!fromExt4 && gPrivateTmpfs.empty()) {
    state.SkipWithError("no second tmpfs (mounting one needs root)");
    return;
  }
  const std::string from =
      qsbench::makeScratchDirectory(fromExt4 ? qsbench::temporaryDirectory() : kSharedMemory, "qs-bench-move");
  const std::string to = qsbench::makeScratchDirectory(fromExt4 ? kSharedMemory : gPrivateTmpfs, "qs-bench-move");
  const std::string source = from + "/source", destination = to + "/moved";
  for (auto _ : state) {
    if (from.empty() || to.empty()) {
      state.SkipWithError("no scratch directory");
      break;
    }
    state.PauseTiming();
    qsbench::runCommand("rm -rf '" + destination + "'");
    bool built = buildShape(source, shape);
    state.ResumeTiming();
    if (!built || !move(source, destination)) {
      state.SkipWithError("building or moving the tree failed");
      break;
    }
  }
  for (const std::string& scratch : {from, to}) {
    if (!scratch.empty()) qsbench::runCommand("rm -rf '" + scratch + "'");
  }
}

void BM_MoveItemAtURL(benchmark::State& state) {
  moveTrees(state, moveWithFileManager);
}
void BM_CoreutilsCpARmRf(benchmark::State& state) {
  moveTrees(state, moveWithCoreutils);
}

void routesAndShapes(benchmark::internal::Benchmark* b) {
  b->ArgNames({"route", "shape"})->ArgsProduct({{0, 1}, {0, 1, 2}});
  b->Iterations(5)->UseRealTime()->Unit(benchmark::kMillisecond);
}

}  // namespace

BENCHMARK(BM_MoveItemAtURL)->Apply(routesAndShapes);
BENCHMARK(BM_CoreutilsCpARmRf)->Apply(routesAndShapes);

// The second tmpfs is mounted in a mount namespace of the process's own, so
// that it goes away with the process however it ends.
int main(int argc, char** argv) {
  benchmark::Initialize(&argc, argv);
  std::string mountPoint = qsbench::makeScratchDirectory(qsbench::temporaryDirectory(), "qs-bench-tmpfs");
  if (!mountPoint.empty() && unshare(CLONE_NEWNS) == 0 &&
      mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0 &&
      mount("qs-bench", mountPoint.c_str(), "tmpfs", 0, "size=4g") == 0) {
    gPrivateTmpfs = mountPoint;
  }
  benchmark::RunSpecifiedBenchmarks();
  benchmark::Shutdown();
  if (!gPrivateTmpfs.empty()) umount2(gPrivateTmpfs.c_str(), MNT_DETACH);
  if (!mountPoint.empty()) rmdir(mountPoint.c_str());
  return 0;
}
