#include "Tools/devicegen/FileOps.h"

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <limits.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <memory>

#include "Platform/FileSystem.h"

namespace devicegen {
namespace {

// Large enough to read most generated files in one call, small enough to
// stay in cache.
constexpr size_t kReadChunk = 1 << 20;

bool fail(std::string* why, const char* call, const std::string& path, int err) {
  if (why) *why = std::string(call) + " " + path + ": " + strerror(err);
  return false;
}

}  // namespace

bool makeDirectories(const std::string& path, std::string* why) {
  const int err = platform::makeDirectories(path, kDirectoryMode);
  return err == 0 || fail(why, "mkdir", path, err);
}

bool writeWholeFile(const std::string& path, const void* bytes, size_t length, mode_t mode, std::string* why) {
  UniqueFd fd(open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC | O_NOFOLLOW, mode));
  if (!fd.valid()) return fail(why, "open", path, errno);
  const auto* cursor = static_cast<const uint8_t*>(bytes);
  while (length > 0) {
    const ssize_t written = write(fd.get(), cursor, length);
    if (written < 0) {
      if (errno == EINTR) continue;
      return fail(why, "write", path, errno);
    }
    cursor += written;
    length -= static_cast<size_t>(written);
  }
  // An existing file keeps its mode through O_CREAT; make it what was asked.
  if (fchmod(fd.get(), mode) != 0) return fail(why, "fchmod", path, errno);
  return true;
}

bool makeSymlink(const std::string& target, const std::string& path, std::string* why) {
  if (symlink(target.c_str(), path.c_str()) != 0) return fail(why, "symlink", path, errno);
  return true;
}

ItemKind itemKind(const std::string& path, uint64_t* size) {
  struct stat st;
  if (lstat(path.c_str(), &st) != 0) return ItemKind::Missing;
  if (S_ISREG(st.st_mode)) {
    if (size) *size = static_cast<uint64_t>(st.st_size);
    return ItemKind::File;
  }
  if (S_ISDIR(st.st_mode)) return ItemKind::Directory;
  if (S_ISLNK(st.st_mode)) return ItemKind::Link;
  return ItemKind::Other;
}

std::optional<std::string> readLinkText(const std::string& path) {
  std::string text(PATH_MAX, '\0');
  const ssize_t length = readlink(path.c_str(), text.data(), text.size());
  if (length < 0) return std::nullopt;
  text.resize(static_cast<size_t>(length));
  return text;
}

bool digestOfFile(const std::string& path, std::vector<uint8_t>& buffer, platform::SHA256Digest* digest, uint64_t* size,
                  std::string* why) {
  UniqueFd fd(open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW));
  if (!fd.valid()) return fail(why, "open", path, errno);
  if (buffer.size() < kReadChunk) buffer.resize(kReadChunk);
  platform::SHA256 hasher;
  uint64_t total = 0;
  for (;;) {
    const ssize_t got = read(fd.get(), buffer.data(), buffer.size());
    if (got < 0) {
      if (errno == EINTR) continue;
      return fail(why, "read", path, errno);
    }
    if (got == 0) break;
    hasher.update(buffer.data(), static_cast<size_t>(got));
    total += static_cast<uint64_t>(got);
  }
  *digest = hasher.finish();
  *size = total;
  return true;
}

std::optional<std::vector<std::string>> directoryEntries(const std::string& path) {
  std::vector<std::string> names;
  if (platform::listDirectory(path, &names) != 0) return std::nullopt;
  return names;
}

std::optional<std::string> canonicalDirectory(const std::string& path, std::string* why) {
  std::unique_ptr<char, decltype(&free)> resolved(realpath(path.c_str(), nullptr), &free);
  if (!resolved) {
    fail(why, "realpath", path, errno);
    return std::nullopt;
  }
  std::string result = resolved.get();
  if (itemKind(result) != ItemKind::Directory) {
    fail(why, "realpath", path, ENOTDIR);
    return std::nullopt;
  }
  return result;
}

}  // namespace devicegen
