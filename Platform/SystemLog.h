// The system log: SystemLogWrite and its replaceable sink.
//
// SystemLogWrite formats one line and hands it to the current sink, which is
// syslog(3) until a process installs another one. Callers apply the level test
// (QSShouldLog in Shared/Support/QSLog.h) before calling.
//
// Thread safety: SystemLogWrite and setSystemLogSink may be called from any
// thread; the sink is called under a process-wide lock, one line at a time.
#pragma once

#include <atomic>
#include <functional>
#include <string>

#include "Platform/Foundation/Format.h"

namespace platform {

// A log handle: what gLogHandle points at. Only the level is read.
struct LogHandle {
  std::atomic<int> level{5};
};

// One line of the system log.
struct SystemLogLine {
  int level = 0;
  std::string function;  // the writing function's name
  std::string message;   // the formatted text
};

using SystemLogSink = std::function<void(const SystemLogLine&)>;

// Installs `sink` (an empty function restores syslog) and returns the previous
// sink (empty when it was syslog).
SystemLogSink setSystemLogSink(SystemLogSink sink);

void SystemLogWriteV(LogHandle* handle, int level, const char* function, const char* format, FormatArgs args);

}  // namespace platform

template <class... Args>
void SystemLogWrite(platform::LogHandle* handle, int level, const char* function, const char* format,
                    const Args&... args) {
  if constexpr (sizeof...(Args) == 0) {
    platform::SystemLogWriteV(handle, level, function, format, {});
  } else {
    const platform::FormatArg captured[] = {platform::FormatArg(args)...};
    platform::SystemLogWriteV(handle, level, function, format, captured);
  }
}
