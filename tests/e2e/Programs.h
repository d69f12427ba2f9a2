// Running the built programs from the end-to-end tests.
#pragma once

#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <string>
#include <utility>
#include <vector>

namespace qstest {

// The built programs lie beside this binary.
inline const std::string kBin = std::filesystem::read_symlink("/proc/self/exe").parent_path().string();

// A program of the build running with its standard output and error in
// `dir`/stdout and `dir`/stderr, TMPDIR `dir`/tmp, and no QS_SYSTEM_ROOT (only
// --root counts).
class Process {
 public:
  // `environment`: further NAME=value settings (TMPDIR among them); a program named by a
  // relative path is one of the build's.
  Process(std::vector<std::string> argv, const std::string& dir,
          const std::vector<std::pair<std::string, std::string>>& environment = {})
      : pid_(fork()) {
    if (pid_ != 0) return;
    if (!freopen((dir + "/stdout").c_str(), "w", stdout) || !freopen((dir + "/stderr").c_str(), "w", stderr))
      _exit(126);
    setenv("TMPDIR", (dir + "/tmp").c_str(), 1);
    unsetenv("QS_SYSTEM_ROOT");
    for (const auto& [name, value] : environment) setenv(name.c_str(), value.c_str(), 1);
    if (argv[0][0] != '/') argv[0] = kBin + "/" + argv[0];
    std::vector<char*> args;
    for (std::string& arg : argv) args.push_back(arg.data());
    args.push_back(nullptr);
    execv(args[0], args.data());
    _exit(127);
  }
  // The exit status, or -signal when it was killed.
  int wait() {
    int status = 0;
    while (waitpid(pid_, &status, 0) < 0 && errno == EINTR) {
    }
    return decode(status);
  }
  bool running() {
    int status = 0;
    if (waitpid(pid_, &status, WNOHANG) == 0) return true;
    exited_ = decode(status);
    return false;
  }
  int exited() const { return exited_; }
  void kill() { ::kill(pid_, SIGKILL); }

 private:
  static int decode(int status) { return WIFEXITED(status) ? WEXITSTATUS(status) : -WTERMSIG(status); }
  pid_t pid_;
  int exited_ = 0;
};


}  // namespace qstest
