#include "Host/LogFile.h"

#include <sys/stat.h>

#include <cerrno>
#include <chrono>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <vector>

#include "Platform/Foundation/Json.h"

namespace transvale {

using platform::jsonQuoted;

namespace {

constexpr char kStandardErrorPath[] = "-";
constexpr char kHostSinkName[] = "host";
constexpr char kSystemSinkName[] = "system";
constexpr mode_t kLogDirectoryMode = 0755;

std::string baseName(const std::string& path) {
  const size_t slash = path.rfind('/');
  return slash == std::string::npos ? path : path.substr(slash + 1);
}

}  // namespace

std::string timestampNow() {
  using namespace std::chrono;
  const auto now = system_clock::now();
  const std::time_t seconds = system_clock::to_time_t(now);
  const auto millis = duration_cast<milliseconds>(now.time_since_epoch()).count() % 1000;
  std::tm utc{};
  gmtime_r(&seconds, &utc);
  char buffer[40];
  const size_t n = std::strftime(buffer, sizeof buffer, "%Y-%m-%dT%H:%M:%S", &utc);
  std::snprintf(buffer + n, sizeof buffer - n, ".%03dZ", static_cast<int>(millis));
  return buffer;
}

std::string formatRecord(const LogRecord& record, LogFormat format, const std::string& timestamp) {
  if (format == LogFormat::Text) {
    std::string text = timestamp + " " + record.sink + " <" + std::to_string(record.level) + ">";
    if (record.category) text += " [" + *record.category + "]";
    text += " " + record.function;
    if (record.file) text += " (" + baseName(*record.file) + ":" + std::to_string(record.line.value_or(0)) + ")";
    return text + ": " + record.message;
  }
  const auto optionalString = [](const std::optional<std::string>& value) {
    return value ? jsonQuoted(*value) : std::string("null");
  };
  return "{\"time\":" + jsonQuoted(timestamp) + ",\"sink\":" + jsonQuoted(record.sink) +
         ",\"level\":" + std::to_string(record.level) + ",\"category\":" + optionalString(record.category) +
         ",\"function\":" + jsonQuoted(record.function) + ",\"file\":" + optionalString(record.file) +
         ",\"line\":" + (record.line ? std::to_string(*record.line) : std::string("null")) +
         ",\"message\":" + jsonQuoted(record.message) + "}";
}

std::unique_ptr<LogFile> LogFile::open(const std::string& path, LogFormat format, std::string* error) {
  if (path == kStandardErrorPath) return std::unique_ptr<LogFile>(new LogFile(stderr, false, format));

  const std::filesystem::path parent = std::filesystem::path(path).parent_path();
  if (!parent.empty()) {
    // Only the directories made here get the log directories' mode; one that
    // was there already (say /tmp) keeps its own.
    std::error_code ec;
    std::vector<std::filesystem::path> made;
    for (std::filesystem::path at = parent; !at.empty() && !std::filesystem::exists(std::filesystem::symlink_status(at, ec));
         at = at.parent_path()) {
      made.push_back(at);
      if (at == at.parent_path()) break;
    }
    std::filesystem::create_directories(parent, ec);
    if (ec) {
      *error = "cannot create the log directory " + parent.string() + ": " + ec.message();
      return nullptr;
    }
    for (const std::filesystem::path& directory : made) ::chmod(directory.c_str(), kLogDirectoryMode);
  }
  std::FILE* stream = std::fopen(path.c_str(), "ae");
  if (!stream) {
    *error = "cannot open the log file " + path + ": " + std::strerror(errno);
    return nullptr;
  }
  return std::unique_ptr<LogFile>(new LogFile(stream, true, format));
}

std::unique_ptr<LogFile> LogFile::discarding(LogFormat format) {
  return std::unique_ptr<LogFile>(new LogFile(nullptr, false, format));
}

LogFile::~LogFile() {
  if (sinksInstalled_) {
    platform::setHostLogSink(std::move(previousHostSink_));
    platform::setSystemLogSink(std::move(previousSystemSink_));
  }
  if (owned_) std::fclose(stream_);
}

void LogFile::write(const LogRecord& record) {
  const std::string line = formatRecord(record, format_, timestampNow()) + "\n";
  std::lock_guard<std::mutex> lock(mutex_);
  if (stream_) {
    std::fwrite(line.data(), 1, line.size(), stream_);
    std::fflush(stream_);
  }
  if (listener_) listener_(record);
}

void LogFile::installSinks() {
  previousHostSink_ = platform::setHostLogSink([this](const platform::HostLogLine& line) {
    write({kHostSinkName, line.level, line.category, line.function, line.file, line.line, line.message});
  });
  previousSystemSink_ = platform::setSystemLogSink([this](const platform::SystemLogLine& line) {
    write({kSystemSinkName, line.level, std::nullopt, line.function, std::nullopt, std::nullopt, line.message});
  });
  sinksInstalled_ = true;
}

}  // namespace transvale
