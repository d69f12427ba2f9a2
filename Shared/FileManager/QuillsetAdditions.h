// QuillsetAdditions: string additions of the file layer.
//
// Names in the file system's own byte representation are kept as std::string
// holding exactly those bytes; the two conversions are therefore lossless and
// give the same string for the same bytes everywhere in the system.
#pragma once

#include <cstddef>
#include <string>
#include <string_view>

namespace QuillsetAdditions {

// A string of exactly `length` bytes at `bytes`; no terminator is needed.
std::string stringWithFileSystemRepresentation(const char* bytes, size_t length);
// A string of the bytes up to the terminator.
std::string stringWithFileSystemRepresentation(const char* bytes);
// True when any "/"-separated component of `path` is exactly "..".
bool containsDotDotPathComponents(std::string_view path);

}  // namespace QuillsetAdditions
