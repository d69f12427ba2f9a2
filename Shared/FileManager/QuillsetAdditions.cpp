#include "Shared/FileManager/QuillsetAdditions.h"

#include <cstring>

#include "Platform/FileTree/TreeWalk.h"

namespace QuillsetAdditions {

namespace {
constexpr char kPathSeparator = '/';
}  // namespace

std::string stringWithFileSystemRepresentation(const char* bytes, size_t length) {
  // Names are kept as their raw bytes: no decoding can fail or lose anything,
  // and the same bytes always give the same string.
  if (bytes == nullptr) return std::string();
  return std::string(bytes, length);
}

std::string stringWithFileSystemRepresentation(const char* bytes) {
  if (bytes == nullptr) return std::string();
  return stringWithFileSystemRepresentation(bytes, std::strlen(bytes));
}

bool containsDotDotPathComponents(std::string_view path) {
  size_t start = 0;
  while (start <= path.size()) {
    size_t end = path.find(kPathSeparator, start);
    if (end == std::string_view::npos) end = path.size();
    if (path.substr(start, end - start) == platform::fs::kParentDirectoryName) return true;
    start = end + 1;
  }
  return false;
}

}  // namespace QuillsetAdditions
