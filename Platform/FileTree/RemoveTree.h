// Recursive removal of a file-system item, built from POSIX calls.
//
// removeTree removes the item at a path: a directory with everything in it,
// or a single item of any other kind. Symbolic links are removed as links and
// never followed. The walk works relative to directory descriptors (so path
// length does not matter) and, as the walks of TreeWalk.h do, iterates and
// bounds its open descriptors, so trees of any depth can be removed.
// Entries that vanish while the walk runs count as removed.
//
// Each item that cannot be removed is handed to the state's error callback
// with the item's path; while the callback runs, the state's errorNumber
// reports why. The callback decides whether the walk goes on. Without a
// callback the walk stops at the first failure.
//
// A state belongs to one call of removeTree at a time; distinct states may be
// used on distinct threads.
#pragma once

#include <cstddef>

#include "Platform/FileTree/TreeWalk.h"

namespace platform::fs {

enum class RemovalDecision { Proceed, Stop };

class RemovalState;
using RemovalErrorCallback = RemovalDecision (*)(const RemovalState& state, const char* path, void* context);

class RemovalState {
 public:
  // Both return 0, or EINVAL for a null argument (the state is then left as
  // it was).
  int setErrorCallback(RemovalErrorCallback callback);
  int setErrorContext(void* context);

  // Writes the error number of the item being reported to *errorNumber and
  // returns 0; returns EINVAL (and writes nothing) when no item is being
  // reported, that is outside the error callback.
  int errorNumber(int* errorNumber) const;

 private:
  friend class TreeRemover;
  RemovalErrorCallback callback_ = nullptr;
  void* context_ = nullptr;
  int currentError_ = 0;  // non-zero only while the callback runs
};

// Returns 0 when the walk ran to its end (every failure was reported to a
// callback that said to proceed), ENOENT when nothing is at `path`, or the
// error number of the failure that stopped the walk.
int removeTree(const char* path, RemovalState& state);

}  // namespace platform::fs
