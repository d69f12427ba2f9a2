#include "TestSupport.h"

#include <fcntl.h>
#include <ftw.h>
#include <grp.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <sstream>

#include <gtest/gtest.h>

namespace platform {
void PrintTo(const Value& value, std::ostream* os) {
  *os << value.description();
}
void PrintTo(const URL& url, std::ostream* os) {
  *os << url.description();
}
void PrintTo(const Error& error, std::ostream* os) {
  *os << error.description();
}
}  // namespace platform

namespace qstest {

const std::string& systemRoot() {
  static const std::string root = [] {
    const char* r = std::getenv("QS_SYSTEM_ROOT");
    return std::string(r ? r : "");
  }();
  return root;
}

namespace {
std::atomic<unsigned> gTempCounter{0};

// Sets or clears FS_IMMUTABLE_FL on an open descriptor.
bool setImmutableFlag(int fd, bool on) {
  int flags = 0;
  if (ioctl(fd, FS_IOC_GETFLAGS, &flags) != 0) return false;
  flags = on ? (flags | FS_IMMUTABLE_FL) : (flags & ~FS_IMMUTABLE_FL);
  return ioctl(fd, FS_IOC_SETFLAGS, &flags) == 0;
}

int clearImmutable(const char* path, const struct stat*, int type, struct FTW*) {
  if (type == FTW_SL || type == FTW_SLN) return 0;
  const int fd = open(path, O_RDONLY | O_NOFOLLOW | O_NONBLOCK);
  if (fd >= 0) (void)setImmutableFlag(fd, false), close(fd);  // a flag it cannot clear fails the removal
  return 0;
}

int removeOne(const char* path, const struct stat*, int type, struct FTW*) {
  int rc = (type == FTW_DP) ? rmdir(path) : unlink(path);
  return rc == 0 ? 0 : errno;
}
}  // namespace

bool removeTree(const std::string& path) {
  nftw(path.c_str(), clearImmutable, 32, FTW_PHYS);  // preorder: flags first
  return nftw(path.c_str(), removeOne, 32, FTW_PHYS | FTW_DEPTH) == 0;
}

TempDir::TempDir(const std::string& prefix) {
  std::string parent = systemRoot() + "/tmp";
  mkdir(parent.c_str(), 0755);
  std::string tmpl = parent + "/" + prefix + "." + std::to_string(getpid()) + "." +
                     std::to_string(gTempCounter.fetch_add(1)) + ".XXXXXX";
  std::vector<char> buf(tmpl.begin(), tmpl.end());
  buf.push_back('\0');
  if (!mkdtemp(buf.data())) {
    ADD_FAILURE() << "mkdtemp " << tmpl << ": " << strerror(errno);
    return;
  }
  path_ = buf.data();
  chmod(path_.c_str(), 0755);
}

TempDir::~TempDir() {
  if (path_.empty()) return;
  EXPECT_TRUE(removeTree(path_)) << "could not remove test directory " << path_;
}

LogCapture::LogCapture() {
  previousSystem_ = platform::setSystemLogSink([this](const platform::SystemLogLine& line) {
    std::lock_guard<std::mutex> lock(mutex_);
    system_.push_back(line);
  });
  previousHost_ = platform::setHostLogSink([this](const platform::HostLogLine& line) {
    std::lock_guard<std::mutex> lock(mutex_);
    host_.push_back(line);
  });
}

LogCapture::~LogCapture() {
  platform::setSystemLogSink(previousSystem_);
  platform::setHostLogSink(previousHost_);
}

std::vector<platform::SystemLogLine> LogCapture::systemLines() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return system_;
}

std::vector<platform::HostLogLine> LogCapture::hostLines() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return host_;
}

template <class Line>
std::vector<std::string> messagesOf(const std::vector<Line>& lines) {
  std::vector<std::string> out;
  for (const Line& l : lines) out.push_back(l.message);
  return out;
}
std::vector<std::string> LogCapture::systemMessages() const {
  return messagesOf(systemLines());
}
std::vector<std::string> LogCapture::hostMessages() const {
  return messagesOf(hostLines());
}

size_t LogCapture::count(const std::string& text) const {
  std::lock_guard<std::mutex> lock(mutex_);
  size_t n = 0;
  for (const auto& l : system_) n += l.message.find(text) != std::string::npos;
  for (const auto& l : host_) n += l.message.find(text) != std::string::npos;
  return n;
}

void LogCapture::clear() {
  std::lock_guard<std::mutex> lock(mutex_);
  system_.clear();
  host_.clear();
}

bool writeFile(const std::string& path, const std::string& contents) {
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out << contents;
  out.close();
  if (!out) {
    ADD_FAILURE() << "cannot write " << path;
    return false;
  }
  return true;
}

std::string readFile(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  std::stringstream ss;
  ss << in.rdbuf();
  return ss.str();
}

bool makeDirs(const std::string& path, unsigned mode) {
  std::string cur;
  size_t pos = 0;
  while (pos != std::string::npos) {
    pos = path.find('/', pos + 1);
    cur = path.substr(0, pos);
    if (cur.empty()) continue;
    if (mkdir(cur.c_str(), mode) != 0 && errno != EEXIST) {
      ADD_FAILURE() << "mkdir " << cur << ": " << strerror(errno);
      return false;
    }
  }
  return true;
}

bool setImmutable(const std::string& path, bool on) {
  const int fd = open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK);
  const bool ok = fd >= 0 && setImmutableFlag(fd, on);
  if (!ok) ADD_FAILURE() << "set immutable " << path << ": " << strerror(errno);
  if (fd >= 0) close(fd);
  return ok;
}

std::vector<std::string> entries(const std::string& directory) {
  std::vector<std::string> names;
  std::error_code missing;
  for (const auto& entry : std::filesystem::directory_iterator(directory, missing))
    names.push_back(entry.path().filename());
  std::sort(names.begin(), names.end());
  return names;
}

int runAsNobody(const std::function<int()>& fn) {
  pid_t pid = fork();
  if (pid < 0) return -1;
  if (pid == 0) {
    if (setgroups(0, nullptr) != 0 || setresgid(65534, 65534, 65534) != 0 || setresuid(65534, 65534, 65534) != 0) {
      _exit(125);
    }
    _exit(fn());
  }
  int status = 0;
  if (waitpid(pid, &status, 0) != pid) return -1;
  return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

}  // namespace qstest
