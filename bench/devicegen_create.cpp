// Writing a 1,000-application device image with the devicegen program built
// beside this benchmark (the target: a few seconds).
//
// Images go under $QS_BENCH_DIR (else $TMPDIR, else /tmp) and are removed
// outside the timed region.
#include <fcntl.h>
#include <ftw.h>
#include <limits.h>
#include <spawn.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <string>
#include <vector>

#include <benchmark/benchmark.h>

extern char** environ;

namespace {

constexpr char kApplications[] = "1000";
constexpr char kFilesPerApp[] = "6";
constexpr char kBytesPerFile[] = "4096";

std::string benchDirectory() {
  for (const char* name : {"QS_BENCH_DIR", "TMPDIR"}) {
    const char* value = std::getenv(name);
    if (value && *value) return value;
  }
  return "/tmp";
}

// The devicegen program in the directory of this executable.
std::string devicegenPath() {
  char self[PATH_MAX];
  const ssize_t length = readlink("/proc/self/exe", self, sizeof self - 1);
  if (length <= 0) return "devicegen";
  std::string path(self, static_cast<size_t>(length));
  return path.substr(0, path.rfind('/') + 1) + "devicegen";
}

// Runs devicegen with `args`, its output discarded; true on exit status 0.
bool runDevicegen(std::vector<std::string> args) {
  const std::string program = devicegenPath();
  args.insert(args.begin(), program);
  std::vector<char*> argv;
  for (auto& arg : args) argv.push_back(arg.data());
  argv.push_back(nullptr);
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_addopen(&actions, STDOUT_FILENO, "/dev/null", O_WRONLY, 0);
  pid_t pid;
  const int spawned = posix_spawn(&pid, program.c_str(), &actions, nullptr, argv.data(), environ);
  posix_spawn_file_actions_destroy(&actions);
  if (spawned != 0) return false;
  int status = 0;
  waitpid(pid, &status, 0);
  return WIFEXITED(status) && WEXITSTATUS(status) == 0;
}

int removeEntry(const char* path, const struct stat*, int type, struct FTW*) {
  return (type == FTW_DP ? rmdir(path) : unlink(path)) == 0 ? 0 : -1;
}

std::string freshRoot() {
  std::string root = benchDirectory() + "/devicegen-bench.XXXXXX";
  if (!mkdtemp(root.data())) return "";
  return root;
}

std::vector<std::string> createArguments(const std::string& root) {
  return {"create",     "--root",           root,          "--apps",         kApplications, "--files-per-app",
          kFilesPerApp, "--bytes-per-file", kBytesPerFile, "--vpn-only",     "10",          "--groups",
          "30",         "--harbors",        "5",           "--placeholders", "10",          "--builtin-older",
          "5"};
}

void BM_CreateThousandApplications(benchmark::State& state) {
  for (auto _ : state) {
    state.PauseTiming();
    const std::string root = freshRoot();
    state.ResumeTiming();
    if (root.empty() || !runDevicegen(createArguments(root))) state.SkipWithError("devicegen create failed");
    state.PauseTiming();
    nftw(root.c_str(), removeEntry, 32, FTW_PHYS | FTW_DEPTH);
    state.ResumeTiming();
  }
}
BENCHMARK(BM_CreateThousandApplications)->Unit(benchmark::kMillisecond)->UseRealTime()->Iterations(3);

}  // namespace

BENCHMARK_MAIN();
