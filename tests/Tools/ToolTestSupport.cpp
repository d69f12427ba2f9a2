#include "ToolTestSupport.h"

#include <dirent.h>
#include <fcntl.h>
#include <ftw.h>
#include <poll.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <openssl/evp.h>

#include <cstdlib>
#include <functional>
#include <memory>

#include <gtest/gtest.h>

#include "Platform/Foundation/PropertyList.h"

namespace tooltest {
namespace {

// Reads both pipes until the child closes them, so that neither can fill up
// and stall it.
void drain(int outFd, int errFd, std::string* out, std::string* err) {
  pollfd fds[2] = {{outFd, POLLIN, 0}, {errFd, POLLIN, 0}};
  std::string* sinks[2] = {out, err};
  int open = 2;
  char buffer[65536];
  while (open > 0) {
    if (poll(fds, 2, -1) < 0) {
      if (errno == EINTR) continue;
      break;
    }
    for (int i = 0; i < 2; ++i) {
      if (fds[i].fd < 0 || !(fds[i].revents & (POLLIN | POLLHUP | POLLERR))) continue;
      const ssize_t got = read(fds[i].fd, buffer, sizeof buffer);
      if (got > 0) {
        sinks[i]->append(buffer, static_cast<size_t>(got));
      } else if (got == 0 || errno != EINTR) {
        close(fds[i].fd);
        fds[i].fd = -1;
        --open;
      }
    }
  }
}

void walk(const std::string& root, const std::string& relative, std::map<std::string, TreeEntry>* tree) {
  const std::string path = relative.empty() ? root : root + "/" + relative;
  std::unique_ptr<DIR, int (*)(DIR*)> dir(opendir(path.c_str()), closedir);
  if (!dir) {
    ADD_FAILURE() << "cannot list " << path;
    return;
  }
  while (const dirent* entry = readdir(dir.get())) {
    const std::string name = entry->d_name;
    if (name == "." || name == "..") continue;
    const std::string childRelative = relative.empty() ? name : relative + "/" + name;
    const std::string child = root + "/" + childRelative;
    struct stat st;
    if (lstat(child.c_str(), &st) != 0) {
      ADD_FAILURE() << "cannot stat " << child;
      continue;
    }
    TreeEntry item;
    if (S_ISDIR(st.st_mode)) {
      item.kind = TreeEntry::Kind::Directory;
      walk(root, childRelative, tree);
    } else if (S_ISLNK(st.st_mode)) {
      item.kind = TreeEntry::Kind::Link;
      char target[4096];
      const ssize_t length = readlink(child.c_str(), target, sizeof target);
      if (length >= 0) item.content.assign(target, static_cast<size_t>(length));
    } else if (S_ISREG(st.st_mode)) {
      item.kind = TreeEntry::Kind::File;
      item.content = readBytes(child);
    }
    (*tree)[childRelative] = std::move(item);
  }
}

int removeEntry(const char* path, const struct stat*, int type, struct FTW*) {
  return (type == FTW_DP ? rmdir(path) : unlink(path)) == 0 ? 0 : errno;
}

}  // namespace

RunResult runTool(const std::string& program, const std::vector<std::string>& args) {
  RunResult result;
  const char* buildDir = std::getenv("QS_BUILD_DIR");
  if (!buildDir) {
    ADD_FAILURE() << "QS_BUILD_DIR is not set (run the tests through ctest)";
    return result;
  }
  const std::string path = std::string(buildDir) + "/bin/" + program;
  int outPipe[2], errPipe[2];
  if (pipe2(outPipe, O_CLOEXEC) != 0 || pipe2(errPipe, O_CLOEXEC) != 0) {
    ADD_FAILURE() << "pipe failed";
    return result;
  }
  std::vector<char*> argv;
  argv.push_back(const_cast<char*>(path.c_str()));
  for (const auto& arg : args) argv.push_back(const_cast<char*>(arg.c_str()));
  argv.push_back(nullptr);
  const pid_t pid = fork();
  if (pid == 0) {
    dup2(outPipe[1], STDOUT_FILENO);
    dup2(errPipe[1], STDERR_FILENO);
    execv(path.c_str(), argv.data());
    _exit(127);
  }
  close(outPipe[1]);
  close(errPipe[1]);
  drain(outPipe[0], errPipe[0], &result.out, &result.err);
  int status = 0;
  while (waitpid(pid, &status, 0) < 0 && errno == EINTR) {
  }
  result.status = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  return result;
}

std::map<std::string, TreeEntry> snapshotTree(const std::string& root) {
  std::map<std::string, TreeEntry> tree;
  walk(root, "", &tree);
  return tree;
}

std::string readBytes(const std::string& path) {
  std::string bytes;
  const int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) {
    ADD_FAILURE() << "cannot open " << path;
    return bytes;
  }
  char buffer[65536];
  ssize_t got;
  while ((got = read(fd, buffer, sizeof buffer)) > 0) bytes.append(buffer, static_cast<size_t>(got));
  close(fd);
  return bytes;
}

std::string sha256Hex(const std::string& bytes) {
  unsigned char digest[EVP_MAX_MD_SIZE];
  unsigned int length = 0;
  EVP_Digest(bytes.data(), bytes.size(), digest, &length, EVP_sha256(), nullptr);
  static constexpr char kHex[] = "0123456789abcdef";
  std::string hex;
  for (unsigned int i = 0; i < length; ++i) {
    hex += kHex[digest[i] >> 4];
    hex += kHex[digest[i] & 0x0F];
  }
  return hex;
}

platform::Dictionary readDictionary(const std::string& path) {
  platform::Error error;
  auto dict = platform::plist::readDictionary(platform::URL::fileURL(path), &error);
  if (!dict) {
    ADD_FAILURE() << "cannot read " << path << ": " << error.description();
    return {};
  }
  return *dict;
}

bool removeTree(const std::string& path) {
  nftw(path.c_str(), removeEntry, 32, FTW_PHYS | FTW_DEPTH);
  return !exists(path);
}

bool exists(const std::string& path) {
  struct stat st;
  return lstat(path.c_str(), &st) == 0;
}

std::vector<std::string> listDirectory(const std::string& path) {
  std::vector<std::string> names;
  std::unique_ptr<DIR, int (*)(DIR*)> dir(opendir(path.c_str()), closedir);
  if (!dir) return names;
  while (const dirent* entry = readdir(dir.get())) {
    const std::string name = entry->d_name;
    if (name != "." && name != "..") names.push_back(name);
  }
  return names;
}

std::string stringAt(const platform::Dictionary& d, const char* key) {
  auto it = d.find(key);
  return it != d.end() && it->second.isString() ? *it->second.asString() : std::string();
}

const platform::Array& arrayAt(const platform::Dictionary& d, const char* key) {
  static const platform::Array* empty = new platform::Array;
  auto it = d.find(key);
  return it != d.end() && it->second.isArray() ? *it->second.asArray() : *empty;
}

}  // namespace tooltest
