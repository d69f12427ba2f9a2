// The file-system calls of devicegen, made directly on POSIX: the tool writes
// thousands of files and must be fast (no per-file fsync, buffers reused by
// the caller), and the verifier must see the tree exactly as it lies (lstat,
// readlink, never following links).
//
// Failure contract: a function that returns false writes a one-line reason
// ("<call> <path>: <system text>") to *why when `why` is not null.
// Thread safety: the functions keep no state.
#pragma once

#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "Platform/Digest.h"
#include "Platform/PosixHandles.h"

namespace devicegen {

using UniqueFd = platform::ScopedFD;

inline constexpr mode_t kDirectoryMode = 0755;
inline constexpr mode_t kFileMode = 0644;
inline constexpr mode_t kExecutableMode = 0755;

// Creates `path` and its missing ancestors (mode 0755); an existing directory
// is success.
[[nodiscard]] bool makeDirectories(const std::string& path, std::string* why);
// Creates or truncates `path` and writes `length` bytes; no fsync.
[[nodiscard]] bool writeWholeFile(const std::string& path, const void* bytes, size_t length, mode_t mode, std::string* why);
[[nodiscard]] bool makeSymlink(const std::string& target, const std::string& path, std::string* why);

enum class ItemKind { Missing, File, Directory, Link, Other };
// What lies at `path` itself (lstat); the size of a regular file in *size.
ItemKind itemKind(const std::string& path, uint64_t* size = nullptr);
// The text of the symbolic link at `path`, or none.
std::optional<std::string> readLinkText(const std::string& path);
// Reads the regular file at `path` through `buffer` (grown as needed and
// reused across calls) and hashes it. Refuses to follow a symbolic link.
[[nodiscard]] bool digestOfFile(const std::string& path, std::vector<uint8_t>& buffer, platform::SHA256Digest* digest, uint64_t* size,
                  std::string* why);
// Names in the directory at `path` ("." and ".." excluded), or none when it
// cannot be read.
std::optional<std::vector<std::string>> directoryEntries(const std::string& path);
// The canonical absolute form of an existing directory.
std::optional<std::string> canonicalDirectory(const std::string& path, std::string* why);

}  // namespace devicegen
