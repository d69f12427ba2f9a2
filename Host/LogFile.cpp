#include "Host/LogFile.h"

#include <sys/stat.h>

#include <cerrno>
#include <chrono>
#include <cstring>
#include <ctime>
#include <filesystem>

#include "Platform/Foundation/Text.h"

namespace transvale {

namespace {

constexpr char kStandardErrorPath[] = "-";
constexpr char kHostSinkName[] = "host";
constexpr char kSystemSinkName[] = "system";
constexpr mode_t kLogDirectoryMode = 0755;

void appendHexEscape(std::string& out, const char* prefix, unsigned char byte) {
  static constexpr char kHex[] = "0123456789abcdef";
  out += prefix;
  out += kHex[byte >> 4];
  out += kHex[byte & 0xF];
}

std::string baseName(const std::string& path) {
  const size_t slash = path.rfind('/');
  return slash == std::string::npos ? path : path.substr(slash + 1);
}

}  // namespace

std::string jsonQuoted(std::string_view bytes) {
  std::string out;
  out.reserve(bytes.size() + 2);
  out += '"';
  for (size_t i = 0; i < bytes.size();) {
    const unsigned char c = static_cast<unsigned char>(bytes[i]);
    if (c < 0x80) {
      switch (c) {
        case '"': out += "\\\""; break;
        case '\\': out += "\\\\"; break;
        case '\n': out += "\\n"; break;
        case '\r': out += "\\r"; break;
        case '\t': out += "\\t"; break;
        case '\b': out += "\\b"; break;
        case '\f': out += "\\f"; break;
        default:
          if (c < 0x20 || c == 0x7F) {
            appendHexEscape(out, "\\u00", c);
          } else {
            out += static_cast<char>(c);
          }
      }
      ++i;
      continue;
    }
    const size_t length = platform::utf8SequenceLength(bytes, i);
    if (length == 0) {
      appendHexEscape(out, "\\udc", c);
      ++i;
      continue;
    }
    out.append(bytes.substr(i, length));
    i += length;
  }
  out += '"';
  return out;
}

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
    std::error_code ec;
    std::filesystem::create_directories(parent, ec);
    if (ec) {
      *error = "cannot create the log directory " + parent.string() + ": " + ec.message();
      return nullptr;
    }
    ::chmod(parent.c_str(), kLogDirectoryMode);
  }
  std::FILE* stream = std::fopen(path.c_str(), "ae");
  if (!stream) {
    *error = "cannot open the log file " + path + ": " + std::strerror(errno);
    return nullptr;
  }
  return std::unique_ptr<LogFile>(new LogFile(stream, true, format));
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
  std::fwrite(line.data(), 1, line.size(), stream_);
  std::fflush(stream_);
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
