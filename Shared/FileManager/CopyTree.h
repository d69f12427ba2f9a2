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
// outside the tree, or in another call's tree, are not looked for.
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

namespace qsfs {

[[nodiscard]] int copyTree(const char* source, const char* destination);

}  // namespace qsfs
