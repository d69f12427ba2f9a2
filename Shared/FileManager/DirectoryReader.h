// Reads the names of a directory open at a descriptor, for the tree walks of
// the file layer (removal and copy), which take a directory's whole listing
// before they change anything in it.
#pragma once

#include <string>
#include <vector>

namespace qsfs {

inline constexpr char kCurrentDirectoryName[] = ".";
inline constexpr char kParentDirectoryName[] = "..";

// True for the two entries every directory lists, "." and "..".
bool isDotOrDotDot(const char* name);

struct DirectoryEntry {
  std::string name;
  unsigned char type = 0;  // DT_* as the directory reported it; DT_UNKNOWN is possible
};

// Appends every entry of the directory open at `directoryFD` except "." and
// ".." to `entries`. `directoryFD` stays open and its position is not used.
// Returns 0 or the error number of the failure (entries read so far stay).
// Thread-safe for distinct descriptors.
[[nodiscard]] int readDirectoryEntries(int directoryFD, std::vector<DirectoryEntry>& entries);

}  // namespace qsfs
