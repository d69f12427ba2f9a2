// Test support shared by every test binary.
//
// Each test binary's main (TestMain.cpp) makes a private system root under the
// temporary directory and exports it as QS_SYSTEM_ROOT before any test runs,
// so that the shared configuration builds its layout there; it is removed
// when the binary ends. Nothing touches the real /private.
#pragma once

#include <functional>
#include <mutex>
#include <string>
#include <vector>

#include "Platform/Foundation/Error.h"
#include "Platform/Foundation/URL.h"
#include "Platform/Foundation/Value.h"
#include "Platform/Host/HostLog.h"
#include "Platform/SystemLog.h"

// Values, URLs and error records print as their descriptions in failed
// assertions (containers of them too), instead of as raw bytes.
namespace platform {
void PrintTo(const Value& value, std::ostream* os);
void PrintTo(const URL& url, std::ostream* os);
void PrintTo(const Error& error, std::ostream* os);
}  // namespace platform

namespace qstest {

// The binary's system root (QS_SYSTEM_ROOT), without a trailing separator.
const std::string& systemRoot();

// A fresh, uniquely named directory under the system root's "tmp" folder,
// removed (immutable flags cleared first) when the object goes away. Tests
// assert that the removal succeeded.
class TempDir {
 public:
  explicit TempDir(const std::string& prefix = "t");
  ~TempDir();
  TempDir(const TempDir&) = delete;
  TempDir& operator=(const TempDir&) = delete;
  const std::string& path() const { return path_; }
  std::string operator/(const std::string& rest) const { return path_ + "/" + rest; }

 private:
  std::string path_;
};

// Captures the system log and the host log for its lifetime (both sinks are
// restored afterwards). Thread-safe.
class LogCapture {
 public:
  LogCapture();
  ~LogCapture();
  LogCapture(const LogCapture&) = delete;
  LogCapture& operator=(const LogCapture&) = delete;

  std::vector<platform::SystemLogLine> systemLines() const;
  std::vector<platform::HostLogLine> hostLines() const;
  // Messages only, in order.
  std::vector<std::string> systemMessages() const;
  std::vector<std::string> hostMessages() const;
  // Number of lines (either sink) whose message contains `text`.
  size_t count(const std::string& text) const;
  bool contains(const std::string& text) const { return count(text) > 0; }
  void clear();

 private:
  mutable std::mutex mutex_;
  std::vector<platform::SystemLogLine> system_;
  std::vector<platform::HostLogLine> host_;
  platform::SystemLogSink previousSystem_;
  platform::HostLogSink previousHost_;
};

// File helpers for building trees in tests. They abort the test (ADD_FAILURE
// and return false) on failure.
bool writeFile(const std::string& path, const std::string& contents);
std::string readFile(const std::string& path);
bool makeDirs(const std::string& path, unsigned mode = 0755);
// Sets or clears the immutable flag (FS_IMMUTABLE_FL) on `path`.
bool setImmutable(const std::string& path, bool on);
// Removes the tree at `path`, not following links, immutable flags cleared
// first; false when something remains. Reports no test failure itself.
bool removeTree(const std::string& path);
// The entries of a directory, sorted (none when it cannot be listed).
std::vector<std::string> entries(const std::string& directory);
// Runs `fn` in a forked child that has dropped to uid/gid 65534; returns the
// child's exit status (fn's result), or -1 when the child died otherwise.
int runAsNobody(const std::function<int()>& fn);

}  // namespace qstest
