#include "ToolTestSupport.h"

#include <fcntl.h>
#include <spawn.h>
#include <sys/wait.h>

#include <openssl/evp.h>

#include <cstdlib>
#include <filesystem>

#include <gtest/gtest.h>

#include "Platform/Foundation/PropertyList.h"
#include "support/TestSupport.h"

extern char** environ;

namespace tooltest {

namespace fs = std::filesystem;

RunResult runTool(const std::string& program, const std::vector<std::string>& args) {
  RunResult result;
  const char* buildDir = std::getenv("QS_BUILD_DIR");
  if (!buildDir) {
    ADD_FAILURE() << "QS_BUILD_DIR is not set (run the tests through ctest)";
    return result;
  }
  const std::string path = std::string(buildDir) + "/bin/" + program;
  std::vector<char*> argv{const_cast<char*>(path.c_str())};
  for (const auto& arg : args) argv.push_back(const_cast<char*>(arg.c_str()));
  argv.push_back(nullptr);
  // The output goes to files, which cannot fill up and stall the program.
  qstest::TempDir output("output");
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_addopen(&actions, STDOUT_FILENO, (output / "out").c_str(), O_WRONLY | O_CREAT, 0600);
  posix_spawn_file_actions_addopen(&actions, STDERR_FILENO, (output / "err").c_str(), O_WRONLY | O_CREAT, 0600);
  pid_t pid = -1;
  int status = 0;
  const int spawned = posix_spawn(&pid, path.c_str(), &actions, nullptr, argv.data(), environ);
  posix_spawn_file_actions_destroy(&actions);
  if (spawned != 0) {
    ADD_FAILURE() << "cannot run " << path;
    return result;
  }
  while (waitpid(pid, &status, 0) < 0 && errno == EINTR) {
  }
  result.status = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  result.out = qstest::readFile(output / "out");
  result.err = qstest::readFile(output / "err");
  return result;
}

std::map<std::string, TreeEntry> snapshotTree(const std::string& root) {
  std::map<std::string, TreeEntry> tree;
  std::error_code error;
  for (fs::recursive_directory_iterator it(root, error), end; !error && it != end; it.increment(error)) {
    TreeEntry item;
    const fs::file_status status = it->symlink_status();
    if (fs::is_directory(status)) {
      item.kind = TreeEntry::Kind::Directory;
    } else if (fs::is_symlink(status)) {
      item.kind = TreeEntry::Kind::Link;
      item.content = fs::read_symlink(it->path()).native();
    } else if (fs::is_regular_file(status)) {
      item.kind = TreeEntry::Kind::File;
      item.content = qstest::readFile(it->path());
    }
    tree[it->path().native().substr(root.size() + 1)] = std::move(item);
  }
  if (error) ADD_FAILURE() << "cannot walk " << root << ": " << error.message();
  return tree;
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
  if (!dict) ADD_FAILURE() << "cannot read " << path << ": " << error.description();
  return dict ? *dict : platform::Dictionary{};
}

bool removeTree(const std::string& path) {
  std::error_code error;
  fs::remove_all(path, error);
  return !exists(path);
}

bool exists(const std::string& path) {
  std::error_code error;
  return fs::exists(fs::symlink_status(path, error));
}

std::vector<std::string> listDirectory(const std::string& path) {
  std::vector<std::string> names;
  std::error_code missing;
  for (const auto& entry : fs::directory_iterator(path, missing)) names.push_back(entry.path().filename());
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
