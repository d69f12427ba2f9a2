// File-system primitives shared by the file layer, the registry and the
// tools: what each of them would otherwise write again.
//
// The calls return 0 or the error number of the system call that failed, for
// the caller to turn into its own error record.
//
// Thread safety: pure functions of the file system.
#pragma once

#include <sys/types.h>

#include <string>
#include <vector>

namespace platform {

// Whether `path` is a directory, following a link as path resolution would.
bool isDirectory(const std::string& path);
// Whether `path` leads to an item, links followed: a dangling link does not
// count. For paths the system itself publishes (sysfs), links included.
bool pathLeadsToItem(const std::string& path);
// Whether there is an item at `path` itself, a link counting as one even when
// it leads nowhere: for undoing and redoing one's own renames and removals.
bool itemExists(const std::string& path);

// The names in the directory at `path` ("." and ".." excluded), sorted, into
// *names.
int listDirectory(const std::string& path, std::vector<std::string>* names);

// Creates `path` and every missing ancestor, each with `mode`. An existing
// directory is no failure; an existing item of another kind fails with
// EEXIST (at the end of the path) or ENOTDIR (in the middle). Works upwards
// only as far as needed, so an existing parent costs one call.
int makeDirectories(const std::string& path, mode_t mode);

}  // namespace platform
