#include "Platform/FileSystem.h"

#include <sys/stat.h>

#include <cerrno>
#include <vector>

namespace platform {

namespace {

constexpr char kPathSeparator = '/';

// mkdir that tolerates an existing directory.
int makeOneDirectory(const std::string& path, mode_t mode) {
  if (mkdir(path.c_str(), mode) == 0) return 0;
  int errnum = errno;
  if (errnum == EEXIST && isDirectory(path)) return 0;
  return errnum;
}

}  // namespace

bool isDirectory(const std::string& path) {
  struct stat status {};
  return stat(path.c_str(), &status) == 0 && S_ISDIR(status.st_mode);
}

int makeDirectories(const std::string& path, mode_t mode) {
  std::vector<size_t> missing;  // lengths of the prefixes still to create, deepest first
  size_t length = path.size();
  for (;;) {
    int errnum = makeOneDirectory(path.substr(0, length), mode);
    if (errnum == 0) break;
    if (errnum != ENOENT) return errnum;
    missing.push_back(length);
    size_t slash = path.rfind(kPathSeparator, length - 1);
    while (slash != std::string::npos && slash > 0 && path[slash - 1] == kPathSeparator) --slash;
    if (slash == std::string::npos || slash == 0) return ENOENT;  // no ancestor left to create
    length = slash;
  }
  for (auto it = missing.rbegin(); it != missing.rend(); ++it) {
    if (int errnum = makeOneDirectory(path.substr(0, *it), mode); errnum != 0) return errnum;
  }
  return 0;
}

}  // namespace platform
