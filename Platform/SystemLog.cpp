#include "Platform/SystemLog.h"

#include <syslog.h>

#include <mutex>

namespace platform {

namespace {

// Guards the sink and serialises the lines written through it.
std::mutex& sinkMutex() {
  static auto* m = new std::mutex;
  return *m;
}

SystemLogSink& currentSink() {
  static auto* sink = new SystemLogSink;
  return *sink;
}

int syslogPriority(int level) {
  if (level <= 3) return LOG_ERR;
  if (level <= 5) return LOG_NOTICE;
  return LOG_DEBUG;
}

}  // namespace

SystemLogSink setSystemLogSink(SystemLogSink sink) {
  std::lock_guard<std::mutex> lock(sinkMutex());
  SystemLogSink previous = std::move(currentSink());
  currentSink() = std::move(sink);
  return previous;
}

void SystemLogWriteV(LogHandle* handle, int level, const char* function, const char* format, FormatArgs args) {
  (void)handle;  // the level test is the caller's; the handle only identifies the log
  SystemLogLine line{level, function ? function : "", FormatV(format, args)};
  std::lock_guard<std::mutex> lock(sinkMutex());
  if (currentSink()) {
    currentSink()(line);
    return;
  }
  syslog(syslogPriority(level), "%s: %s", line.function.c_str(), line.message.c_str());
}

}  // namespace platform
