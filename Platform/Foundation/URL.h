// URL: a file-system location, an absolute path plus an is-directory flag.
//
// The path is kept as the file system's own bytes; every system call is made
// on fileSystemRepresentation(). Paths are kept as given except that repeated
// separators are collapsed and a trailing separator is dropped (the root "/"
// stays "/"); the is-directory flag says whether the location is meant as a
// directory, and the description shows it as a trailing "/".
//
// An empty URL (no path) stands for "no URL" where an interface allows it.
#pragma once

#include <string>
#include <string_view>
#include <vector>

namespace platform {

class URL {
 public:
  URL() = default;
  // A file URL for `path`. A relative path is taken as given (no base is
  // applied); callers build absolute paths.
  static URL fileURL(std::string_view path, bool isDirectory = false);

  bool empty() const { return path_.empty(); }
  const std::string& path() const { return path_; }
  const char* fileSystemRepresentation() const { return path_.c_str(); }
  bool isDirectory() const { return isDirectory_; }

  // The location of `component` inside this one. `component` may hold
  // separators ("Library/Caches/x.plist"), which become path separators.
  URL appending(std::string_view component, bool isDirectory = false) const;
  // The same location with "." and the extension appended to the last
  // component.
  URL appendingPathExtension(std::string_view extension) const;
  // The parent location, always a directory URL; "/" is its own parent.
  URL deletingLastPathComponent() const;

  // The last component of the path ("" for an empty URL, "/" for the root).
  std::string lastPathComponent() const;
  // The extension of the last component: the text after its last ".", or ""
  // when it has none (a leading dot, as in ".profile", is no extension).
  std::string pathExtension() const;

  // "file://" + path, with a trailing "/" for directory URLs.
  std::string description() const;

  // Equality compares the paths only, as the file system would.
  bool operator==(const URL& other) const { return path_ == other.path_; }
  bool operator<(const URL& other) const { return path_ < other.path_; }

 private:
  std::string path_;
  bool isDirectory_ = false;
};

// Path-string helpers shared by URL and the file layer.
namespace path {
// Components as the platform splits them: an absolute path's first component
// is "/"; names between separators follow; a trailing separator yields a
// final "/" component. "/a//b/" gives {"/", "a", "b", "/"}.
std::vector<std::string> components(std::string_view path);
// Joins two path parts with exactly one separator between them.
std::string join(std::string_view base, std::string_view rest);
}  // namespace path

}  // namespace platform
