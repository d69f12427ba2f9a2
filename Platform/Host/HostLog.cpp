#include "Platform/Host/HostLog.h"

#include <cstdio>
#include <mutex>

namespace platform {

namespace {

// Guards the sink and serialises the lines written through it.
std::mutex& sinkMutex() {
  static auto* m = new std::mutex;
  return *m;
}

HostLogSink& currentSink() {
  static auto* sink = new HostLogSink;
  return *sink;
}

}  // namespace

HostLogSink setHostLogSink(HostLogSink sink) {
  std::lock_guard<std::mutex> lock(sinkMutex());
  HostLogSink previous = std::move(currentSink());
  currentSink() = std::move(sink);
  return previous;
}

void HostLogV(const char* file, const char* function, int line, const char* category, int level, const char* format,
              FormatArgs args) {
  HostLogLine record{file ? file : "", function ? function : "", line, category ? category : "", level,
                     FormatV(format, args)};
  std::lock_guard<std::mutex> lock(sinkMutex());
  if (currentSink()) {
    currentSink()(record);
    return;
  }
  std::fprintf(stderr, "<%d> [%s] %s: %s\n", record.level, record.category.c_str(), record.function.c_str(),
               record.message.c_str());
}

}  // namespace platform
