#include "Platform/Foundation/PathContainment.h"

#include <limits.h>
#include <stdlib.h>
#include <sys/stat.h>

#include <vector>

#include "Platform/Foundation/URL.h"

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

std::optional<std::string> realPath(const std::string& path) {
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

Placement placementOf(std::string_view candidate, std::string_view base) {
  const std::optional<std::string> realCandidate = resolvedAsFarAsExists(candidate);
  const std::optional<std::string> realBase = resolvedAsFarAsExists(base);
  if (!realCandidate || !realBase) return Placement::Unusable;
  const std::vector<std::string> c = *names(*realCandidate);
  const std::vector<std::string> b = *names(*realBase);
  if (c.size() < b.size()) return Placement::Outside;
  for (size_t i = 0; i < b.size(); ++i) {
    if (c[i] != b[i]) return Placement::Outside;
  }
  return c.size() == b.size() ? Placement::Same : Placement::Inside;
}

bool liesInside(std::string_view candidate, std::string_view base) {
  return placementOf(candidate, base) == Placement::Inside;
}

bool liesInsideOrAt(std::string_view candidate, std::string_view base) {
  const Placement placement = placementOf(candidate, base);
  return placement == Placement::Inside || placement == Placement::Same;
}

}  // namespace platform::path
