// Support for the tests of the built programs devicegen and appregistry: run
// a program and collect its output, snapshot a tree, read property lists,
// and the places of an image's layout as the tests expect them.
#pragma once

#include <sys/wait.h>
#include <unistd.h>

#include <gmock/gmock.h>

#include <cstdlib>
#include <map>

#include "Platform/Digest.h"
#include "Platform/Foundation/Text.h"
#include "Platform/RegistryFixture.h"

namespace tooltest {

namespace fs = std::filesystem;
using platform::Dictionary;
using platform::Value;
using qstest::entries;
using qstest::exists;
using testing::_;
using testing::AllOf;
using testing::EndsWith;
using testing::Eq;
using testing::HasSubstr;
using testing::IsEmpty;
using testing::Not;
using testing::PrintToString;
using testing::StartsWith;

// Layout of an image under its root, as the programs must produce it.
inline constexpr char kOldApplications[] = "/private/var/mobile/Applications";
inline constexpr char kInstallMap[] = "/private/var/mobile/Library/Caches/com.vantrel.quill.set.plist";
inline constexpr char kSafeHarborMap[] = "/private/var/quilld/Library/Quillset/SafeHarbor.plist";
inline constexpr char kLastSystemVersion[] = "/private/var/quilld/Library/Quillset/AppMigratorLastSystemVersion.plist";
inline constexpr char kSystemVersion[] = "/System/Library/CoreServices/SystemVersion.plist";
inline constexpr char kManifest[] = "/devicegen-manifest.plist";
inline constexpr int kUsageStatus = 64;
inline constexpr int kNotRun = 127;  // the program could not be started
// devicegen create's options for a small image with something of every kind.
inline const std::vector<std::string> kStandardOptions = {
    "--apps",    "8", "--vpn-only",     "2", "--groups",        "3", "--files-per-app", "9", "--bytes-per-file", "1500",
    "--harbors", "2", "--placeholders", "1", "--builtin-older", "2", "--seed",          "7"};

struct RunResult {
  int status = -1;  // exit status; -1 when the program did not exit normally
  std::string out, err;
};
inline void PrintTo(const RunResult& r, std::ostream* os) {
  *os << "exit " << r.status << "\n--- stdout:\n" << r.out << "--- stderr:\n" << r.err;
}
// A run that exited with `status`, its standard error and output matching.
inline testing::Matcher<const RunResult&> exited(int status, testing::Matcher<const std::string&> err = testing::_,
                                                 testing::Matcher<const std::string&> out = testing::_) {
  return testing::AllOf(testing::Field("status", &RunResult::status, status),
                        testing::Field("err", &RunResult::err, err), testing::Field("out", &RunResult::out, out));
}

// Runs $QS_BUILD_DIR/bin/<program> with `args` and waits for it. The output
// goes to files, which cannot fill up and stall the program.
inline RunResult runTool(const std::string& program, std::vector<std::string> args) {
  const char* build = std::getenv("QS_BUILD_DIR");
  EXPECT_TRUE(build) << "QS_BUILD_DIR is not set (run the tests through ctest)";
  args.insert(args.begin(), std::string(build ? build : "") + "/bin/" + program);
  qstest::TempDir output("output");
  const pid_t pid = fork();
  if (pid == 0) {
    if (!freopen((output / "out").c_str(), "w", stdout) || !freopen((output / "err").c_str(), "w", stderr))
      _exit(kNotRun);
    std::vector<char*> argv;
    for (std::string& arg : args) argv.push_back(arg.data());
    argv.push_back(nullptr);
    execv(argv[0], argv.data());
    _exit(kNotRun);
  }
  int status = 0;
  while (waitpid(pid, &status, 0) < 0 && errno == EINTR) {
  }
  return {WIFEXITED(status) ? WEXITSTATUS(status) : -1, qstest::readFile(output / "out"),
          qstest::readFile(output / "err")};
}

// Runs devicegen create on `root` with `options`.
inline RunResult createImage(const std::string& root, std::vector<std::string> options = kStandardOptions) {
  options.insert(options.begin(), {"create", "--root", root});
  return runTool("devicegen", options);
}

// Every item below `root` (not following links) by path relative to it:
// "d" for a directory, "l" + link text, "f" + file bytes.
inline std::map<std::string, std::string> snapshotTree(const std::string& root) {
  std::map<std::string, std::string> tree;
  std::error_code error;
  for (fs::recursive_directory_iterator it(root, error), end; !error && it != end; it.increment(error)) {
    const fs::file_status status = it->symlink_status();
    tree[it->path().native().substr(root.size() + 1)] =
        fs::is_directory(status)      ? "d"
        : fs::is_symlink(status)      ? "l" + fs::read_symlink(it->path()).native()
        : fs::is_regular_file(status) ? "f" + qstest::readFile(it->path())
                                      : "?";
  }
  if (error) ADD_FAILURE() << "cannot walk " << root << ": " << error.message();
  return tree;
}

inline std::string sha256Hex(const std::string& bytes) {
  const platform::SHA256Digest digest = platform::sha256(bytes.data(), bytes.size());
  return platform::hexString(digest.data(), digest.size());
}

// The dictionary in the property list at `path`; an empty one (and a test
// failure) when it cannot be read.
inline Dictionary readDictionary(const std::string& path) {
  platform::Error error;
  auto dict = platform::plist::readDictionary(platform::URL::fileURL(path), &error);
  if (!dict) ADD_FAILURE() << "cannot read " << path << ": " << error.description();
  return dict ? *dict : Dictionary{};
}
// A string value's text, or "" (for terse lookups in manifests).
inline std::string stringAt(const Dictionary& d, const char* key) {
  auto it = d.find(key);
  return it != d.end() && it->second.isString() ? *it->second.asString() : std::string();
}
inline const platform::Array& arrayAt(const Dictionary& d, const char* key) {
  static const platform::Array* empty = new platform::Array;
  auto it = d.find(key);
  return it != d.end() && it->second.isArray() ? *it->second.asArray() : *empty;
}

}  // namespace tooltest
