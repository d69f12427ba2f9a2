// Logging of the runtime support: gLogHandle, the level test and the macro
// that every SystemLogWrite caller of this system goes through.
#pragma once

#include <atomic>

#include "Platform/SystemLog.h"

// Log levels, the same numbers for both sinks.
inline constexpr int kQSLogLevelError = 3;
inline constexpr int kQSLogLevelNotice = 5;
inline constexpr int kQSLogLevelDebug = 7;

// The process-wide log handle, initially absent. Nothing in this system sets
// it; an embedding process (the host) may. Read afresh for every line; atomic
// so that a host thread may set it while another thread logs.
extern std::atomic<platform::LogHandle*> gLogHandle;

// The level test: a line of level 3 or 5 is written when there is no handle
// or the handle's level is at least the line's; a level-7 line only when there
// is a handle whose level is at least 7.
bool QSShouldLog(int level);

// Writes one system-log line under `function` when the level test passes.
#define QS_SYSLOG(level, function, ...)                             \
  do {                                                              \
    if (QSShouldLog(level)) {                                       \
      SystemLogWrite(gLogHandle.load(), (level), (function), __VA_ARGS__); \
    }                                                               \
  } while (0)
