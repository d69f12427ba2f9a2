// File-system work of the registry: containers are made, filled, moved and
// removed here, and every POSIX failure becomes an error record of
// kRegistryErrorDomain (kRegistryErrorFileOperation) naming the operation and
// the path, with the POSIX error underneath.
//
// Out-parameter contract: `error` is written if and only if the call fails.
// Thread safety: every function may be called from any thread; none keeps
// state.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "Platform/FileSystem.h"
#include "Platform/Foundation/Error.h"
#include "Platform/PosixHandles.h"

namespace platform::registry {

// The record for a failed POSIX call: kRegistryErrorDomain, `code`, message
// "<what> <path>: <strerror>", the POSIX error (errnum) underneath.
Error posixFailure(int64_t code, const std::string& what, const std::string& path, int errnum);
// A registry error without an underlying error.
Error registryError(int64_t code, const std::string& message);

// isDirectory is the platform's (FileSystem.h).
// A directory itself, not a symbolic link to one.
bool isDirectoryNoFollow(const std::string& path);

// Names in a directory, "." and ".." excluded, sorted. Fails when the
// directory cannot be opened or read.
std::optional<std::vector<std::string>> listDirectory(const std::string& path, Error* error);

// mkdir -p with mode 0755; an existing directory is success.
[[nodiscard]] bool makeDirectories(const std::string& path, Error* error);
// Makes the missing parents of `path` and then `path` itself, which must not
// exist yet (so that undoing it can never remove something older).
[[nodiscard]] bool createNewDirectory(const std::string& path, Error* error);
// Removes the item at `path` and everything under it (platform::fs::removeTree,
// links never followed); nothing there is success. A failure names the item
// that could not be removed.
[[nodiscard]] bool removeTree(const std::string& path, Error* error);
// Copies the tree at `source` to `destination` (which must not exist) with
// platform::fs::copyTree: every item keeps its data, mode, owner, times and
// extended attributes. Nothing is flushed: the caller makes the copy durable
// with syncFileSystems.
[[nodiscard]] bool copyTree(const std::string& source, const std::string& destination, Error* error);
// Renames `source` to `destination`. Only a rename can be undone after a crash,
// so there is no copying fallback: across file systems this fails (EXDEV).
[[nodiscard]] bool moveItem(const std::string& source, const std::string& destination, Error* error);
// Flushes the file system of each path (syncfs): every change made there
// before, data and names, survives a power loss. Each file system is flushed
// once, at the place of its last path, so the file system of the last path
// is flushed after every other.
[[nodiscard]] bool syncFileSystems(const std::vector<std::string>& paths, Error* error);
// Writes `bytes` to a new file at `path`, not flushed (see copyTree).
[[nodiscard]] bool writeNewFile(const std::string& path, const std::vector<uint8_t>& bytes, Error* error);
// Sets the data-protection class attribute of the directory at `path`.
[[nodiscard]] bool setProtectionClass(const std::string& path, int32_t protectionClass, Error* error);

// A random UUID in upper-case 8-4-4-4-12 form (version 4).
std::optional<std::string> newUUID(Error* error);

// An exclusive flock(2) on a lock file, released when the object goes away.
// Locks taken through distinct objects exclude each other, also inside one
// process.
class FileLock {
 public:
  // Blocks until the lock is held; none when the lock file cannot be opened.
  static std::optional<FileLock> acquire(const std::string& path, Error* error);

 private:
  explicit FileLock(ScopedFD fd) : fd_(std::move(fd)) {}
  ScopedFD fd_;  // closing it releases the lock
};

}  // namespace platform::registry
