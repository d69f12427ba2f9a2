// Recursive copy of a file-system item, built from POSIX calls.
//
// copyTree copies the item at `source` to `destination`: a directory with
// everything in it, a regular file, a symbolic link (as a link, never
// followed), or a device, fifo or socket node. Every item keeps its data, its
// extended attributes of every namespace that can be read (access-control
// lists included), its mode, owner, group and access and modification times.
//
// Copies are faithful beyond that: a regular file shares its blocks with the
// source where the file system can (a clone), otherwise only its data extents
// are copied, so its holes stay holes; and items with several names in the
// tree (hard links) are copied once, their further names linked to that copy.
// Where a link cannot be made, the item is copied again instead. Names
// outside the tree are not looked for, nor names in another call's tree
// unless both calls share a CopyLinkTable.
//
// Extended attributes whose names start with kMoveAttributePrefix are the
// file layer's own marks of a move under way: they are never copied.
//
// Nothing is merged or replaced: an existing item at `destination` fails the
// copy with EEXIST. The copy stops at the first failure and leaves what it
// had copied so far. Entries of the source that vanish while the copy runs
// are left out. Copying a directory into itself fails with EINVAL.
//
// The walk iterates instead of recursing and bounds its open descriptors (see
// TreeWalk.h), so trees of any depth can be copied. A directory of the source
// or the copy that is moved away while the walk is below it fails the copy
// with EAGAIN.
//
// Returns 0 or the error number of the failure. Thread-safe; nothing shared.
#pragma once

#include <sys/types.h>

#include <ctime>
#include <map>
#include <string>
#include <utility>
#include <vector>

namespace platform::fs {

inline constexpr char kMoveAttributePrefix[] = "trusted.qs-move.";

// The copy of an item with several names, made under one of them: further
// names of its source are made links to it.
struct LinkedCopy {
  size_t top = 0;                 // the copied tree it lies in (CopyLinkTable::tops)
  std::vector<std::string> path;  // names from that tree's top down to the copy's own; empty: the top itself
  dev_t device = 0;               // of the copy
  ino_t inode = 0;
  off_t sourceSize = 0;           // of the source, so that an inode the system reused is not taken for it
  timespec sourceModified{};
  nlink_t namesLeft = 0;          // names of the source not met yet
};

// The copies of items with several names, shared by several copyTree calls
// (the items of one container), so that names of one inode in different
// trees arrive as names of one inode. Its user tells it where a copied tree
// went (renamed) or that it is gone; a link is only ever made to a copy
// that is still the recorded inode.
struct CopyLinkTable {
  std::vector<std::string> tops;  // the path of each copied tree's top; "" once it is gone
  std::map<std::pair<dev_t, ino_t>, LinkedCopy> copies;  // by the source's device and inode

  void topRenamed(const std::string& from, const std::string& to);
  void topRemoved(const std::string& top);
};

[[nodiscard]] int copyTree(const char* source, const char* destination, CopyLinkTable* links = nullptr);

}  // namespace platform::fs
