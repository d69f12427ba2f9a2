// Support for the tests of the built programs devicegen and appregistry: run
// a program and collect its output, snapshot a tree, read property lists,
// and the places of an image's layout as the tests expect them.
#pragma once

#include <map>
#include <string>
#include <vector>

#include "Platform/Foundation/Value.h"

namespace tooltest {

// Layout of an image under its root, as the programs must produce it.
inline constexpr char kOldApplications[] = "/private/var/mobile/Applications";
inline constexpr char kInstallMap[] = "/private/var/mobile/Library/Caches/com.vantrel.quill.set.plist";
inline constexpr char kDataDirectory[] = "/private/var/quilld/Library/Quillset";
inline constexpr char kSafeHarborMap[] = "/private/var/quilld/Library/Quillset/SafeHarbor.plist";
inline constexpr char kLastSystemVersion[] = "/private/var/quilld/Library/Quillset/AppMigratorLastSystemVersion.plist";
inline constexpr char kSystemVersion[] = "/System/Library/CoreServices/SystemVersion.plist";
inline constexpr char kSystemApplications[] = "/Applications";
inline constexpr char kManifest[] = "/devicegen-manifest.plist";
inline constexpr char kPlaceholderAttribute[] = "user.com.vantrel.quilld.placeholder";
inline constexpr int kUsageStatus = 64;

struct RunResult {
  int status = -1;  // exit status; -1 when the program did not exit normally
  std::string out;
  std::string err;
};

// Runs $QS_BUILD_DIR/bin/<program> with `args` and waits for it.
RunResult runTool(const std::string& program, const std::vector<std::string>& args);

struct TreeEntry {
  enum class Kind { File, Directory, Link, Other } kind = Kind::Other;
  std::string content;  // file bytes or link text
  bool operator==(const TreeEntry&) const = default;
};
// Every item below `root` (not following links), by path relative to it.
std::map<std::string, TreeEntry> snapshotTree(const std::string& root);

std::string sha256Hex(const std::string& bytes);
// The dictionary in the property list at `path`; an empty one (and a test
// failure) when it cannot be read.
platform::Dictionary readDictionary(const std::string& path);
// Removes `path` and everything below it; true when nothing is left.
bool removeTree(const std::string& path);
bool exists(const std::string& path);
std::vector<std::string> listDirectory(const std::string& path);

// A string Value's text, or "" (for terse lookups in manifests).
std::string stringAt(const platform::Dictionary& d, const char* key);
const platform::Array& arrayAt(const platform::Dictionary& d, const char* key);

}  // namespace tooltest
