// Pieces shared by the tree walks of the file layer (removal and copy).
//
// Both walks work relative to directory descriptors, iterate instead of
// recursing, and take a directory's whole listing when they enter it, before
// they change anything in it. So that a tree of any depth can be walked, they
// keep the descriptors of at most kMaxOpenDirectories levels open; a level
// whose descriptors were closed is reopened from its child through "..",
// checked by device and inode against what was recorded when it was entered.
// (Removal holds one descriptor per open level, copy two.)
//
// All functions are thread-safe for distinct descriptors.
#pragma once

#include <sys/types.h>

#include <cstddef>
#include <string>
#include <vector>

namespace platform::fs {

inline constexpr size_t kMaxOpenDirectories = 128;

inline constexpr char kCurrentDirectoryName[] = ".";
inline constexpr char kParentDirectoryName[] = "..";

// True for the two entries every directory lists, "." and "..".
bool isDotOrDotDot(const char* name);

struct DirectoryEntry {
  std::string name;
  unsigned char type = 0;  // DT_* as the directory reported it; DT_UNKNOWN is possible
};

// True when `fd` is open on the item with `device` and `inode`.
bool isSameItem(int fd, dev_t device, ino_t inode);

// Opens the parent of the directory open at `childFD` and returns the new
// descriptor when it is still the directory with `device` and `inode`;
// otherwise -1 with errno set (EAGAIN when another directory is there now).
int openParentDirectory(int childFD, dev_t device, ino_t inode);

// Appends every entry of the directory open at `directoryFD` except "." and
// ".." to `entries`. `directoryFD` stays open and its position is not used.
// Returns 0 or the error number of the failure (entries read so far stay).
[[nodiscard]] int readDirectoryEntries(int directoryFD, std::vector<DirectoryEntry>& entries);

}  // namespace platform::fs
