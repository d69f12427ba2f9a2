// Path containment for paths the system did not make itself: whether a path
// read from a file (a marker, a map, a registry row) lies inside the place it
// is allowed to act on.
//
// Both paths are absolute. Each is resolved as far as it exists (realpath of
// the longest existing leading part, the missing rest appended), so a
// symbolic link on the way that leads out of the base is judged by where it
// leads, never by its name. A path with a ".." component, a relative path or
// an empty one is unusable: nothing a caller acts on needs one.
//
// The answer describes the file system at the time of the call; a caller
// that acts later must not give an untrusted writer the chance to swap a
// directory for a link meanwhile (the places checked here are written by the
// system, or by nobody during a run).
//
// Thread safety: pure functions of the file system's state, except
// ResolvedDirectories, which locks its own cache.
#pragma once

#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

namespace platform::path {

enum class Placement {
  Inside,    // strictly below the base
  Same,      // the base itself
  Outside,   // anywhere else, an ancestor of the base included
  Unusable,  // relative, empty, with a ".." component, or not resolvable
};

Placement placementOf(std::string_view candidate, std::string_view base);

// placementOf(...) == Placement::Inside.
bool liesInside(std::string_view candidate, std::string_view base);
// Inside or Same.
bool liesInsideOrAt(std::string_view candidate, std::string_view base);

// placementOf() for paths that resolvedAsFarAsExists() gave, for a caller
// that holds a path against many and resolves each once. Unusable when either
// is none.
Placement placementOfResolved(const std::optional<std::string>& candidate, const std::optional<std::string>& base);

// Directories resolved once, on first use, and kept: for a caller that holds
// many paths against the same few directories, which only it changes, and
// only by making them (a directory made where a path did not exist yet
// resolves to the same name). Each path is resolved by resolvedAsFarAsExists().
class ResolvedDirectories {
 public:
  // The kept resolution of `directory`; the reference stays valid until clear().
  const std::optional<std::string>& operator()(const std::string& directory);
  // Whether `candidate`, resolved now, lies strictly inside `directory`.
  bool holdsInside(std::string_view candidate, const std::string& directory);
  void clear();

 private:
  std::mutex mutex_;
  std::map<std::string, std::optional<std::string>> resolved_;
};

// The path with every existing leading part resolved (realpath) and the
// missing rest appended; "." and empty components dropped. None when the path
// is unusable as above.
std::optional<std::string> resolvedAsFarAsExists(std::string_view path);

}  // namespace platform::path
