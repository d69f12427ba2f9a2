#include "Platform/Foundation/PathContainment.h"

#include <fcntl.h>
#include <limits.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <vector>

#include "Platform/Foundation/URL.h"
#include "Platform/PosixHandles.h"

namespace platform::path {

namespace {

constexpr std::string_view kRoot = "/";
constexpr std::string_view kCurrent = ".";
constexpr std::string_view kParent = "..";

// The names of an absolute path ("/" and "." left out); none when the path is
// relative, empty or climbs with "..".
std::optional<std::vector<std::string>> names(std::string_view path) {
  if (path.empty() || path.front() != '/') return std::nullopt;
  std::vector<std::string> out;
  for (std::string& component : components(path)) {
    if (component == kParent) return std::nullopt;
    if (component.empty() || component == kRoot || component == kCurrent) continue;
    out.push_back(std::move(component));
  }
  return out;
}

std::string joined(const std::vector<std::string>& parts, size_t count) {
  std::string out;
  for (size_t i = 0; i < count; ++i) out += "/" + parts[i];
  return out.empty() ? std::string(kRoot) : out;
}

constexpr char kDescriptorLinkFormat[] = "/proc/self/fd/%d";
constexpr std::string_view kDeletedSuffix = " (deleted)";

// The kernel's own name for an open descriptor's file: one lookup of the
// whole path, where realpath(3) reads each leading part as a possible link
// (a path of n parts costs n lookups of 1..n parts each).
std::optional<std::string> kernelPath(int fd) {
  char link[sizeof(kDescriptorLinkFormat) + 16];
  std::snprintf(link, sizeof link, kDescriptorLinkFormat, fd);
  char resolved[PATH_MAX];
  const ssize_t length = ::readlink(link, resolved, sizeof resolved);
  if (length <= 0 || static_cast<size_t>(length) >= sizeof resolved || resolved[0] != '/') return std::nullopt;
  std::string out(resolved, static_cast<size_t>(length));
  // A file removed meanwhile is named with a suffix that is not in any path.
  if (out.ends_with(kDeletedSuffix)) return std::nullopt;
  return out;
}

std::optional<std::string> realPath(const std::string& path) {
  const ScopedFD fd(::open(path.c_str(), O_PATH | O_CLOEXEC));
  if (!fd.valid()) return std::nullopt;  // missing, a dangling or looping link: as realpath(3)
  if (std::optional<std::string> named = kernelPath(fd.get())) return named;
  // No /proc, or a name that cannot be told apart: the C library's walk.
  char resolved[PATH_MAX] = {};
  if (!::realpath(path.c_str(), resolved)) return std::nullopt;
  return std::string(resolved);
}

}  // namespace

std::optional<std::string> resolvedAsFarAsExists(std::string_view path) {
  const std::optional<std::vector<std::string>> parts = names(path);
  if (!parts) return std::nullopt;
  // Longest leading part first: a link anywhere in what exists is resolved.
  for (size_t k = parts->size() + 1; k-- > 0;) {
    std::optional<std::string> real = realPath(joined(*parts, k));
    if (!real) continue;
    // The first missing part must be truly missing: a dangling or looping
    // link there leads somewhere that cannot be judged.
    struct stat status;
    if (k < parts->size() && ::lstat(joined(*parts, k + 1).c_str(), &status) == 0) return std::nullopt;
    std::string out = *real == kRoot ? "" : *real;
    for (size_t i = k; i < parts->size(); ++i) out += "/" + (*parts)[i];
    return out.empty() ? std::string(kRoot) : out;
  }
  return std::nullopt;
}

namespace {

// Where resolved names `c` lie against resolved names `b`.
Placement compareResolved(const std::vector<std::string>& c, const std::vector<std::string>& b) {
  if (c.size() < b.size()) return Placement::Outside;
  for (size_t i = 0; i < b.size(); ++i) {
    if (c[i] != b[i]) return Placement::Outside;
  }
  return c.size() == b.size() ? Placement::Same : Placement::Inside;
}

std::optional<std::vector<std::string>> resolvedNames(std::string_view path) {
  const std::optional<std::string> real = resolvedAsFarAsExists(path);
  if (!real) return std::nullopt;
  return names(*real);
}

}  // namespace

Placement placementOf(std::string_view candidate, std::string_view base) {
  const std::optional<std::vector<std::string>> c = resolvedNames(candidate);
  const std::optional<std::vector<std::string>> b = resolvedNames(base);
  if (!c || !b) return Placement::Unusable;
  return compareResolved(*c, *b);
}

Placement placementOfResolved(const std::optional<std::string>& candidate, const std::optional<std::string>& base) {
  const std::optional<std::vector<std::string>> c = candidate ? names(*candidate) : std::nullopt;
  const std::optional<std::vector<std::string>> b = base ? names(*base) : std::nullopt;
  if (!c || !b) return Placement::Unusable;
  return compareResolved(*c, *b);
}

const std::optional<std::string>& ResolvedDirectories::operator()(const std::string& directory) {
  std::lock_guard lock(mutex_);
  auto found = resolved_.find(directory);
  if (found == resolved_.end()) found = resolved_.emplace(directory, resolvedAsFarAsExists(directory)).first;
  return found->second;
}

bool ResolvedDirectories::holdsInside(std::string_view candidate, const std::string& directory) {
  return placementOfResolved(resolvedAsFarAsExists(candidate), (*this)(directory)) == Placement::Inside;
}

void ResolvedDirectories::clear() {
  std::lock_guard lock(mutex_);
  resolved_.clear();
}

bool liesInside(std::string_view candidate, std::string_view base) {
  return placementOf(candidate, base) == Placement::Inside;
}

bool liesInsideOrAt(std::string_view candidate, std::string_view base) {
  const Placement placement = placementOf(candidate, base);
  return placement == Placement::Inside || placement == Placement::Same;
}

}  // namespace platform::path
