// HostLog: the data-migration host's logger, and its replaceable sink.
//
// The host (transvale) installs a sink that writes the log file; until one is
// installed, lines go to standard error. HostLog applies no level test; any
// filtering is the sink's.
//
// Thread safety: HostLog and setHostLogSink may be called from any thread; the
// sink is called under a process-wide lock, one line at a time.
#pragma once

#include <functional>
#include <string>

#include "Platform/Foundation/Format.h"

namespace platform {

struct HostLogLine {
  std::string file;      // the writing source file
  std::string function;  // the writing function's full name
  int line = 0;          // the source line
  std::string category;  // "Transvaler" for every line of the migrator
  int level = 0;         // 3 or 5
  std::string message;   // the formatted text
};

using HostLogSink = std::function<void(const HostLogLine&)>;

// Installs `sink` (an empty function restores the standard-error sink) and
// returns the previous one.
HostLogSink setHostLogSink(HostLogSink sink);

void HostLogV(const char* file, const char* function, int line, const char* category, int level, const char* format,
              FormatArgs args);

}  // namespace platform

template <class... Args>
void HostLog(const char* file, const char* function, int line, const char* category, int level, const char* format,
             const Args&... args) {
  if constexpr (sizeof...(Args) == 0) {
    platform::HostLogV(file, function, line, category, level, format, {});
  } else {
    const platform::FormatArg captured[] = {platform::FormatArg(args)...};
    platform::HostLogV(file, function, line, category, level, format, captured);
  }
}
