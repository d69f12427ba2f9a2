#include "fuzz/FuzzFiles.h"

#include <fcntl.h>
#include <stdlib.h>
#include <unistd.h>

#include <filesystem>

namespace qsfuzz {

const std::string& scratchRoot() {
  static const std::string root = [] {
    const char* tmp = getenv("TMPDIR");
    std::string pattern = std::string(tmp && *tmp ? tmp : "/tmp") + "/qs-fuzz.XXXXXX";
    if (!mkdtemp(pattern.data())) abort();
    setenv("QS_SYSTEM_ROOT", pattern.c_str(), 1);
    return pattern;
  }();
  return root;
}

bool writeInput(const std::string& path, const uint8_t* data, size_t size) {
  std::error_code ignored;
  std::filesystem::create_directories(std::filesystem::path(path).parent_path(), ignored);
  const int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
  if (fd < 0) return false;
  const bool written = size == 0 || write(fd, data, size) == static_cast<ssize_t>(size);
  return close(fd) == 0 && written;
}

}  // namespace qsfuzz
