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

namespace platform {

// Whether `path` is a directory, following a link as path resolution would.
bool isDirectory(const std::string& path);

// Creates `path` and every missing ancestor, each with `mode`. An existing
// directory is no failure; an existing item of another kind fails with
// EEXIST (at the end of the path) or ENOTDIR (in the middle). Works upwards
// only as far as needed, so an existing parent costs one call.
int makeDirectories(const std::string& path, mode_t mode);

}  // namespace platform
