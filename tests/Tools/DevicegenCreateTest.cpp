// devicegen create: the images it writes, run as a program on temporary roots.
#include <sys/xattr.h>

#include <algorithm>
#include <set>

#include <gtest/gtest.h>

#include "Platform/Registry/BundleInfo.h"
#include "ToolTestSupport.h"
#include "support/TestSupport.h"

namespace {

using platform::Dictionary;
using platform::Value;
using tooltest::TreeEntry;

const std::vector<std::string> kStandardOptions = {
    "--apps",    "8", "--vpn-only",     "2", "--groups",        "3", "--files-per-app", "9", "--bytes-per-file", "1500",
    "--harbors", "2", "--placeholders", "1", "--builtin-older", "2", "--seed",          "7"};

std::string replaceAll(std::string text, const std::string& from, const std::string& to) {
  for (size_t at = text.find(from); at != std::string::npos; at = text.find(from, at + to.size())) {
    text.replace(at, from.size(), to);
  }
  return text;
}

// The bytes of a manifest path, which is a string or, for a name that is not
// UTF-8, data under "PathBytes".
std::string itemPath(const Dictionary& item) {
  auto bytes = item.find("PathBytes");
  if (bytes != item.end() && bytes->second.isData()) {
    return std::string(bytes->second.asData()->begin(), bytes->second.asData()->end());
  }
  return tooltest::stringAt(item, "Path");
}

class DevicegenCreate : public ::testing::Test {
 protected:
  tooltest::RunResult create(const std::string& root, std::vector<std::string> options = kStandardOptions) {
    std::vector<std::string> args = {"create", "--root", root};
    args.insert(args.end(), options.begin(), options.end());
    return tooltest::runTool("devicegen", args);
  }
  // An image made with the standard options; fails the test when it cannot
  // be made.
  std::string standardImage(const std::string& name = "image") {
    const std::string root = dir_ / name;
    const tooltest::RunResult run = create(root);
    EXPECT_EQ(run.status, 0) << run.err;
    return root;
  }
  Dictionary manifest(const std::string& root) { return tooltest::readDictionary(root + tooltest::kManifest); }

  qstest::TempDir dir_{"devicegen-create"};
};

TEST_F(DevicegenCreate, SameSeedGivesIdenticalImagesUnderDifferentRootsAnotherSeedAnother) {
  const std::string first = standardImage("first");
  const std::string second = standardImage("second");
  auto a = tooltest::snapshotTree(first);
  const auto b = tooltest::snapshotTree(second);
  ASSERT_GT(a.size(), 300u);
  // The install map and the safe-harbor map record real absolute paths.
  for (auto& [path, entry] : a) entry.content = replaceAll(entry.content, first + "/", second + "/");
  ASSERT_EQ(a.size(), b.size());
  for (const auto& [path, entry] : a) {
    auto other = b.find(path);
    ASSERT_NE(other, b.end()) << "only in the first image: " << path;
    EXPECT_TRUE(entry == other->second) << "differs: " << path;
  }
  std::vector<std::string> options = kStandardOptions;
  options.back() = "8";
  const std::string third = dir_ / "third";
  ASSERT_EQ(create(third, options).status, 0);
  EXPECT_NE(qstest::readFile(first + tooltest::kManifest), qstest::readFile(third + tooltest::kManifest));
  EXPECT_NE(tooltest::listDirectory(first + tooltest::kOldApplications),
            tooltest::listDirectory(third + tooltest::kOldApplications));
}

TEST_F(DevicegenCreate, ManifestListsEveryUserItemWithSizeDigestAndLinkText) {
  const std::string root = standardImage();
  const Dictionary m = manifest(root);
  // Owner identifier -> container path relative to the root.
  std::map<std::pair<std::string, std::string>, std::string> containers;
  for (const Value& v : tooltest::arrayAt(m, "Containers")) {
    containers[{"App", tooltest::stringAt(*v.asDictionary(), "Identifier")}] =
        tooltest::stringAt(*v.asDictionary(), "Container");
  }
  for (const Value& v : tooltest::arrayAt(m, "Groups")) {
    containers[{"Group", tooltest::stringAt(*v.asDictionary(), "Identifier")}] =
        tooltest::stringAt(*v.asDictionary(), "Container");
  }
  ASSERT_EQ(containers.size(), 8u + 2u + 3u);

  // What the manifest lists, per container.
  std::map<std::string, std::map<std::string, const Dictionary*>> listed;
  uint64_t files = 0, bytes = 0;
  for (const Value& v : tooltest::arrayAt(m, "Items")) {
    const Dictionary& item = *v.asDictionary();
    const auto key = std::make_pair(tooltest::stringAt(item, "Owner"), tooltest::stringAt(item, "Identifier"));
    ASSERT_TRUE(containers.count(key)) << key.first << " " << key.second;
    listed[containers[key]][itemPath(item)] = &item;
  }
  const std::set<std::string> userData = {"Documents", "Library", "tmp", "Tillbox"};
  for (const auto& [owner, container] : containers) {
    // Everything of the user's below the container, as it lies on disk.
    std::map<std::string, TreeEntry> onDisk;
    for (const auto& [path, entry] : tooltest::snapshotTree(root + "/" + container)) {
      if (owner.first == "Group" || userData.count(path.substr(0, path.find('/')))) onDisk[path] = entry;
    }
    const auto& items = listed[container];
    EXPECT_EQ(onDisk.size(), items.size()) << container;
    for (const auto& [path, entry] : onDisk) {
      auto found = items.find(path);
      ASSERT_NE(found, items.end()) << "not in the manifest: " << container << "/" << path;
      const Dictionary& item = *found->second;
      switch (entry.kind) {
        case TreeEntry::Kind::File:
          EXPECT_EQ(tooltest::stringAt(item, "Kind"), "File") << path;
          EXPECT_EQ(item.at("Size").uint64Value(), entry.content.size()) << path;
          EXPECT_EQ(tooltest::stringAt(item, "SHA256"), tooltest::sha256Hex(entry.content)) << path;
          ++files;
          bytes += entry.content.size();
          break;
        case TreeEntry::Kind::Link:
          EXPECT_EQ(tooltest::stringAt(item, "Kind"), "Link") << path;
          EXPECT_EQ(tooltest::stringAt(item, "LinkTarget"), entry.content) << path;
          EXPECT_NE(entry.content.front(), '/') << "links are relative: " << path;
          break;
        case TreeEntry::Kind::Directory:
          EXPECT_EQ(tooltest::stringAt(item, "Kind"), "Directory") << path;
          break;
        case TreeEntry::Kind::Other:
          ADD_FAILURE() << "unexpected item " << path;
      }
    }
  }
  const Dictionary& totals = *m.at("Totals").asDictionary();
  EXPECT_EQ(totals.at("Files").uint64Value(), files);
  EXPECT_EQ(totals.at("Bytes").uint64Value(), bytes);
}

TEST_F(DevicegenCreate, ContainersHoldBundlesPluginsPlaceholdersAndStoreMetadata) {
  const std::string root = standardImage();
  const Dictionary m = manifest(root);
  std::set<std::string> carriedPlugins, vpnOnlyPlugins;
  size_t placeholders = 0;
  for (const Value& v : tooltest::arrayAt(m, "Containers")) {
    const Dictionary& c = *v.asDictionary();
    const std::string container = root + "/" + tooltest::stringAt(c, "Container");
    const std::string bundle = container + "/" + tooltest::stringAt(c, "Bundle");
    const Dictionary info = tooltest::readDictionary(bundle + "/Info.plist");
    EXPECT_EQ(tooltest::stringAt(info, "RkBundleIdentifier"), tooltest::stringAt(c, "Identifier"));
    std::vector<std::string> apps, plugins;
    for (const std::string& name : tooltest::listDirectory(container)) {
      if (name.ends_with(".app")) apps.push_back(name);
      if (name.ends_with(".vpnplugin")) plugins.push_back(name);
    }
    char mark[8];
    const ssize_t markLength = getxattr(bundle.c_str(), tooltest::kPlaceholderAttribute, mark, sizeof mark);
    if (tooltest::stringAt(c, "Kind") == "VPNOnly") {
      EXPECT_TRUE(apps.empty()) << container;
      EXPECT_EQ(plugins.size(), 1u) << container;
      vpnOnlyPlugins.insert(tooltest::stringAt(c, "Identifier"));
      continue;
    }
    EXPECT_EQ(apps.size(), 1u) << container;
    EXPECT_TRUE(tooltest::exists(bundle + "/Icon.png"));
    if (c.at("Placeholder").boolValue()) {
      ++placeholders;
      ASSERT_EQ(markLength, 4) << bundle;
      EXPECT_EQ(std::string(mark, 4), std::string("\x01\x00\x00\x00", 4));
    } else {
      EXPECT_EQ(markLength, -1) << bundle;
      EXPECT_TRUE(tooltest::exists(bundle + "/" + tooltest::stringAt(info, "RkBundleExecutable")));
    }
    const std::string plugin = tooltest::stringAt(c, "VPNPluginIdentifier");
    EXPECT_EQ(plugins.size(), plugin.empty() ? 0u : 1u) << container;
    if (!plugin.empty()) {
      carriedPlugins.insert(plugin);
      const Dictionary pluginInfo = tooltest::readDictionary(container + "/" + plugins.at(0) + "/Info.plist");
      EXPECT_EQ(tooltest::stringAt(pluginInfo, "RkBundleIdentifier"), plugin);
    }
    EXPECT_EQ(tooltest::exists(container + "/VendraMetadata.plist"), c.at("StoreMetadata").boolValue()) << container;
  }
  EXPECT_EQ(placeholders, 1u);
  ASSERT_EQ(vpnOnlyPlugins.size(), 2u);
  for (const std::string& plugin : vpnOnlyPlugins) EXPECT_TRUE(carriedPlugins.count(plugin)) << plugin;
  // Every container, plus the note the previous release left.
  const auto entries = tooltest::listDirectory(root + tooltest::kOldApplications);
  EXPECT_EQ(entries.size(), 8u + 2u + 1u);
  EXPECT_EQ(std::count(entries.begin(), entries.end(), "WhereDidMyApplicationsGo.txt"), 1);
}

TEST_F(DevicegenCreate, BuiltInCopiesOfOldApplicationsAreEqualOrNewer) {
  const std::string root = standardImage();
  const Dictionary m = manifest(root);
  std::map<std::string, std::string> builtInVersions;
  for (const Value& v : tooltest::arrayAt(m, "BuiltInApplications")) {
    const Dictionary& b = *v.asDictionary();
    const Dictionary info = tooltest::readDictionary(root + "/" + tooltest::stringAt(b, "Bundle") + "/Info.plist");
    EXPECT_EQ(tooltest::stringAt(info, "RkBundleVersion"), tooltest::stringAt(b, "Version"));
    builtInVersions[tooltest::stringAt(info, "RkBundleIdentifier")] = tooltest::stringAt(info, "RkBundleVersion");
    EXPECT_EQ(tooltest::stringAt(b, "Bundle").rfind("Applications/", 0), 0u);
  }
  size_t refusals = 0;
  for (const Value& v : tooltest::arrayAt(m, "Containers")) {
    const Dictionary& c = *v.asDictionary();
    const std::string identifier = tooltest::stringAt(c, "Identifier");
    if (!c.at("BuiltInRefusal").boolValue()) {
      EXPECT_FALSE(builtInVersions.count(identifier)) << identifier;
      continue;
    }
    ++refusals;
    ASSERT_TRUE(builtInVersions.count(identifier)) << identifier;
    EXPECT_GE(platform::registry::compareBundleVersions(builtInVersions[identifier], tooltest::stringAt(c, "Version")), 0) << identifier;
    // The registry keeps the built-in copy, whose record has no old groups.
    EXPECT_TRUE(tooltest::arrayAt(c, "Groups").empty());
    EXPECT_EQ(tooltest::stringAt(c, "VPNPluginIdentifier"), "");
  }
  EXPECT_EQ(refusals, 2u);
  EXPECT_EQ(builtInVersions.size(), 2u + 3u);
}

TEST_F(DevicegenCreate, InstallMapAndSafeHarborMapPointAtExistingDirectories) {
  const std::string root = standardImage();
  const Dictionary installMap = tooltest::readDictionary(root + tooltest::kInstallMap);
  ASSERT_TRUE(installMap.count("GroupContainers"));
  const Dictionary& groups = *installMap.at("GroupContainers").asDictionary();
  EXPECT_EQ(groups.size(), 3u);
  for (const auto& [group, entry] : groups) {
    const std::string path = tooltest::stringAt(*entry.asDictionary(), "Container");
    EXPECT_EQ(path.rfind(root + "/", 0), 0u) << path;
    EXPECT_FALSE(tooltest::listDirectory(path).empty()) << group;
  }
  size_t shared = 0;
  const Dictionary m = manifest(root);
  for (const Value& v : tooltest::arrayAt(m, "Groups")) {
    shared += tooltest::arrayAt(*v.asDictionary(), "Members").size() == 3;
  }
  EXPECT_GE(shared, 1u) << "a group shared by three applications";

  const Dictionary harbors = tooltest::readDictionary(root + tooltest::kSafeHarborMap);
  EXPECT_EQ(harbors.size(), 2u);
  for (const auto& [identifier, entry] : harbors) {
    const std::string path = tooltest::stringAt(*entry.asDictionary(), "HarborPathKey");
    EXPECT_EQ(path.rfind(root + "/", 0), 0u) << path;
    EXPECT_FALSE(tooltest::listDirectory(path).empty()) << identifier;
  }
  const Dictionary version = tooltest::readDictionary(root + tooltest::kSystemVersion);
  for (const char* key : {"BuildVersion", "ProductVersion", "ProductName"}) {
    EXPECT_FALSE(tooltest::stringAt(version, key).empty()) << key;
  }
  EXPECT_EQ(Value(version), m.at("SystemVersion"));
}

TEST_F(DevicegenCreate, IconsArePNGOfSeveralSizesAndOneNameIsNotUTF8) {
  const std::string root = standardImage();
  std::set<uint32_t> widths;
  size_t invalidNames = 0;
  for (const auto& [path, entry] : tooltest::snapshotTree(root + tooltest::kOldApplications)) {
    invalidNames += path.find('\xFF') != std::string::npos;
    if (!path.ends_with(".app/Icon.png")) continue;
    ASSERT_GE(entry.content.size(), 24u);
    EXPECT_EQ(entry.content.substr(0, 8), std::string("\x89PNG\r\n\x1a\n", 8)) << path;
    const auto* b = reinterpret_cast<const unsigned char*>(entry.content.data());
    widths.insert(uint32_t{b[16]} << 24 | uint32_t{b[17]} << 16 | uint32_t{b[18]} << 8 | b[19]);
  }
  EXPECT_GE(widths.size(), 3u);
  EXPECT_EQ(invalidNames, 1u);
}

TEST_F(DevicegenCreate, ImageWithoutApplicationsHoldsOnlyTheNote) {
  const std::string root = dir_ / "empty";
  const tooltest::RunResult run = create(root, {"--apps", "0"});
  ASSERT_EQ(run.status, 0) << run.err;
  EXPECT_EQ(tooltest::listDirectory(root + tooltest::kOldApplications),
            std::vector<std::string>{"WhereDidMyApplicationsGo.txt"});
  EXPECT_FALSE(tooltest::exists(root + tooltest::kSafeHarborMap));
  EXPECT_TRUE(tooltest::arrayAt(manifest(root), "Items").empty());
}

TEST_F(DevicegenCreate, RefusesToWriteOverAnExistingImage) {
  const std::string root = standardImage();
  const auto before = tooltest::snapshotTree(root);
  const tooltest::RunResult run = create(root);
  EXPECT_EQ(run.status, 1);
  EXPECT_NE(run.err.find("already holds an image"), std::string::npos) << run.err;
  EXPECT_TRUE(tooltest::snapshotTree(root) == before);
}

TEST_F(DevicegenCreate, SummaryCountsApplicationsFilesAndBytes) {
  const std::string root = dir_ / "image";
  const tooltest::RunResult run = create(root, {"--apps", "3", "--files-per-app", "2", "--bytes-per-file", "0"});
  ASSERT_EQ(run.status, 0) << run.err;
  EXPECT_NE(run.out.find("applications: 3 "), std::string::npos) << run.out;
  // Two generated (empty) files, the preferences and the empty file per
  // application, and one name that is not UTF-8.
  EXPECT_NE(run.out.find("files: 13 ("), std::string::npos) << run.out;
}

TEST_F(DevicegenCreate, UsageErrorsExit64AndWriteNothing) {
  const std::string root = dir_ / "never";
  const std::vector<std::vector<std::string>> cases = {
      {}, {"create", "--apps", "3"}, {"create", "--root", root}, {"verify"}, {"frobnicate", "--root", root},
      {"create", "--root", root, "--apps", "2", "--placeholders", "2", "--builtin-older", "1"},
      {"create", "--root", root, "--apps", "2", "--vpn-only", "3"},
      {"create", "--root", root, "--apps", "2", "--placeholders", "2", "--groups", "1"},
      {"create", "--root", root, "--apps", "-1"}, {"create", "--root", root, "--apps", "2", "--colour"}};
  for (const auto& args : cases) {
    const tooltest::RunResult run = tooltest::runTool("devicegen", args);
    std::string joined;
    for (const auto& a : args) joined += a + " ";
    EXPECT_EQ(run.status, tooltest::kUsageStatus) << joined << "\n" << run.err;
    EXPECT_FALSE(run.err.empty()) << joined;
  }
  EXPECT_FALSE(tooltest::exists(root));
  const tooltest::RunResult run = tooltest::runTool(
      "devicegen", {"create", "--root", root, "--apps", "2", "--placeholders", "2", "--builtin-older", "1"});
  EXPECT_NE(run.err.find("exceeds --apps"), std::string::npos) << run.err;
}

}  // namespace
