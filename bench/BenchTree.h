// Trees for the file layer's benchmarks, built with plain POSIX calls under
// the process's temporary directory ($TMPDIR, else /tmp) or /dev/shm.
#pragma once

#include <fcntl.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <string>
#include <vector>

namespace qsbench {

inline std::string temporaryDirectory() {
  const char* tmp = getenv("TMPDIR");
  return tmp && *tmp ? tmp : "/tmp";
}

// A fresh, uniquely named directory under `parent`; empty on failure.
inline std::string makeScratchDirectory(const std::string& parent, const char* prefix) {
  std::string name = parent + "/" + prefix + ".XXXXXX";
  std::vector<char> buffer(name.begin(), name.end());
  buffer.push_back('\0');
  return mkdtemp(buffer.data()) ? std::string(buffer.data()) : std::string();
}

// `directories` directories below `root`, each holding `filesPerDirectory`
// files of `bytesPerFile` bytes. Returns false when anything could not be made.
inline bool buildTree(const std::string& root, int directories, int filesPerDirectory, size_t bytesPerFile) {
  if (mkdir(root.c_str(), 0755) != 0) return false;
  std::string contents(bytesPerFile, 'q');
  for (int d = 0; d < directories; ++d) {
    std::string dir = root + "/dir" + std::to_string(d);
    if (mkdir(dir.c_str(), 0755) != 0) return false;
    for (int f = 0; f < filesPerDirectory; ++f) {
      std::string file = dir + "/file" + std::to_string(f);
      int fd = open(file.c_str(), O_WRONLY | O_CREAT | O_EXCL, 0644);
      if (fd < 0) return false;
      bool written = write(fd, contents.data(), contents.size()) == static_cast<ssize_t>(contents.size());
      close(fd);
      if (!written) return false;
    }
  }
  return true;
}

// Runs a shell command line; true when it exited with 0.
inline bool runCommand(const std::string& commandLine) { return std::system(commandLine.c_str()) == 0; }

}  // namespace qsbench
