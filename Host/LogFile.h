// The host's log: every HostLog and SystemLogWrite line of the process goes to
// one file (or standard error) as text or as JSON lines.
//
// Thread safety: write() may be called from any thread; lines are written
// whole, one at a time, under the object's own lock, and flushed at once so
// that a run that dies leaves every line it wrote.
#pragma once

#include <cstdio>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include "Platform/Host/HostLog.h"
#include "Platform/SystemLog.h"

namespace transvale {

enum class LogFormat { Text, JSONLines };

// One line as the log file shows it: a host line has every field, a system
// line no category, file or line number.
struct LogRecord {
  std::string sink;  // "host" or "system"
  int level = 0;
  std::optional<std::string> category;
  std::string function;
  std::optional<std::string> file;
  std::optional<int> line;
  std::string message;
};

class LogFile {
 public:
  // Opens `path` for appending, making missing parent directories; "-" means
  // standard error. Null with a message in *error when it cannot be opened.
  static std::unique_ptr<LogFile> open(const std::string& path, LogFormat format, std::string* error);
  // A log that keeps no line (a dry run writes nothing); lines still reach
  // the listener.
  static std::unique_ptr<LogFile> discarding(LogFormat format);
  ~LogFile();
  LogFile(const LogFile&) = delete;
  LogFile& operator=(const LogFile&) = delete;

  void write(const LogRecord& record);
  // Also hands every record to `listener` (on the writing thread), until
  // replaced. Set it before the sinks are installed.
  void setListener(std::function<void(const LogRecord&)> listener) { listener_ = std::move(listener); }
  // Routes both sinks of the process here until the object is destroyed, when
  // the previous sinks are put back.
  void installSinks();

 private:
  LogFile(std::FILE* stream, bool owned, LogFormat format) : stream_(stream), owned_(owned), format_(format) {}

  std::mutex mutex_;  // guards stream_ and serialises lines
  std::FILE* stream_;  // null: lines are not kept
  const bool owned_;
  const LogFormat format_;
  bool sinksInstalled_ = false;
  std::function<void(const LogRecord&)> listener_;
  platform::HostLogSink previousHostSink_;
  platform::SystemLogSink previousSystemSink_;
};

// The current time as "YYYY-MM-DDTHH:MM:SS.mmmZ".
std::string timestampNow();

// The record as one line of text or one JSON object, without the newline.
std::string formatRecord(const LogRecord& record, LogFormat format, const std::string& timestamp);

}  // namespace transvale
