#include "Platform/FileSystem.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <vector>

#include "Platform/FileTree/TreeWalk.h"
#include "Platform/PosixHandles.h"

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

bool pathLeadsToItem(const std::string& path) {
  struct stat status {};
  return stat(path.c_str(), &status) == 0;
}

bool itemExists(const std::string& path) {
  struct stat status {};
  return lstat(path.c_str(), &status) == 0;
}

int listDirectory(const std::string& path, std::vector<std::string>* names) {
  const ScopedFD directory(open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!directory.valid()) return errno;
  std::vector<fs::DirectoryEntry> entries;
  if (const int errnum = fs::readDirectoryEntries(directory.get(), entries); errnum != 0) return errnum;
  names->clear();
  for (fs::DirectoryEntry& entry : entries) names->push_back(std::move(entry.name));
  std::sort(names->begin(), names->end());
  return 0;
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
