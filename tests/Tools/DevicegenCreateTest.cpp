// devicegen create: the images it writes, run as a program on temporary roots.
#include <sys/xattr.h>

#include <algorithm>
#include <set>

#include "ToolTestSupport.h"
#include "support/ImageSupport.h"

namespace tooltest {
namespace {

const std::vector<std::string> kStandardOptions = {
    "--apps",    "8", "--vpn-only",     "2", "--groups",        "3", "--files-per-app", "9", "--bytes-per-file", "1500",
    "--harbors", "2", "--placeholders", "1", "--builtin-older", "2", "--seed",          "7"};

class DevicegenCreate : public ::testing::Test {
 protected:
  RunResult create(const std::string& root, std::vector<std::string> options = kStandardOptions) {
    options.insert(options.begin(), {"create", "--root", root});
    return runTool("devicegen", options);
  }
  // An image made with the standard options.
  std::string standardImage(const std::string& name = "image") {
    const RunResult run = create(dir_ / name);
    EXPECT_EQ(run.status, 0) << run.err;
    return dir_ / name;
  }
  qstest::TempDir dir_{"devicegen-create"};
};

// Identical apart from the absolute paths the install map and the
// safe-harbor map record.
TEST_F(DevicegenCreate, SameSeedGivesIdenticalImagesUnderDifferentRootsAnotherSeedAnother) {
  const std::string first = standardImage("first"), second = standardImage("second");
  auto a = snapshotTree(first);
  const auto b = snapshotTree(second);
  ASSERT_GT(a.size(), 300u);
  for (auto& [path, entry] : a) {
    for (size_t at = entry.find(first + "/"); at != std::string::npos; at = entry.find(first + "/", at)) {
      entry.replace(at, first.size(), second);
    }
  }
  const auto [x, y] = std::mismatch(a.begin(), a.end(), b.begin(), b.end());
  EXPECT_TRUE(x == a.end() && y == b.end()) << "differs: " << (x != a.end() ? x->first : y->first);
  std::vector<std::string> options = kStandardOptions;
  options.back() = "8";
  ASSERT_EQ(create(dir_ / "third", options).status, 0);
  EXPECT_NE(qstest::readFile(first + kManifest), qstest::readFile(dir_ / "third" + kManifest));
  EXPECT_NE(listDirectory(first + kOldApplications), listDirectory(dir_ / "third" + kOldApplications));
}

// What the verifier will look for: every user item of every container, as
// it lies on disk, with its size, digest or (relative) link text.
TEST_F(DevicegenCreate, ManifestListsEveryUserItemWithSizeDigestAndLinkText) {
  const std::string root = standardImage();
  const Dictionary m = readDictionary(root + kManifest);
  std::map<std::pair<std::string, std::string>, std::string> containers;  // (owner, identifier) -> container
  for (const char* owner : {"App", "Group"}) {
    for (const Value& v : arrayAt(m, owner == std::string("App") ? "Containers" : "Groups")) {
      containers[{owner, stringAt(*v.asDictionary(), "Identifier")}] = stringAt(*v.asDictionary(), "Container");
    }
  }
  ASSERT_EQ(containers.size(), 8u + 2u + 3u);
  // The bytes of a name that is not UTF-8 are data under "<key>Bytes".
  auto bytesAt = [](const Dictionary& d, const std::string& key) {
    auto data = d.find(key + "Bytes");
    return data == d.end() ? stringAt(d, key.c_str())
                           : std::string(data->second.asData()->begin(), data->second.asData()->end());
  };
  std::map<std::string, std::map<std::string, std::string>> listed;  // container -> path -> description
  uint64_t bytes = 0;
  for (const Value& v : arrayAt(m, "Items")) {
    const Dictionary& item = *v.asDictionary();
    const auto key = std::make_pair(stringAt(item, "Owner"), stringAt(item, "Identifier"));
    ASSERT_TRUE(containers.count(key)) << key.first << " " << key.second;
    const std::string kind = stringAt(item, "Kind");
    listed[containers[key]][bytesAt(item, "Path")] =
        kind == "File"        ? "f" + std::to_string(item.at("Size").uint64Value()) + " " + stringAt(item, "SHA256")
        : kind == "Link"      ? "l" + bytesAt(item, "LinkTarget")
        : kind == "Directory" ? "d"
                              : "?";
    if (kind == "File") bytes += item.at("Size").uint64Value();
  }
  const std::set<std::string> userData = {"Documents", "Library", "tmp", "Tillbox"};
  uint64_t files = 0;
  for (const auto& [owner, container] : containers) {
    std::map<std::string, std::string> onDisk;
    for (auto [path, entry] : snapshotTree(root + "/" + container)) {
      if (owner.first == "App" && !userData.count(path.substr(0, path.find('/')))) continue;
      EXPECT_FALSE(entry.starts_with("l/")) << "links are relative: " << path;
      files += entry[0] == 'f';
      onDisk[path] =
          entry[0] == 'f' ? "f" + std::to_string(entry.size() - 1) + " " + sha256Hex(entry.substr(1)) : entry;
    }
    EXPECT_EQ(onDisk, listed[container]) << container;
  }
  EXPECT_EQ(m.at("Totals").asDictionary()->at("Files").uint64Value(), files);
  EXPECT_EQ(m.at("Totals").asDictionary()->at("Bytes").uint64Value(), bytes);
}

// Placeholder bundles carry the mark the migrator looks for; icons are PNG
// images of several sizes; one name is not UTF-8.
TEST_F(DevicegenCreate, PlaceholdersAreMarkedIconsArePNGAndOneNameIsNotUTF8) {
  const std::string root = standardImage();
  const Dictionary manifest = readDictionary(root + kManifest);
  for (const Value& v : arrayAt(manifest, "Containers")) {
    const Dictionary& c = *v.asDictionary();
    const std::string bundle = root + "/" + stringAt(c, "Container") + "/" + stringAt(c, "Bundle");
    const bool marked = getxattr(bundle.c_str(), "user.com.vantrel.quilld.placeholder", nullptr, 0) >= 0;
    EXPECT_EQ(marked, stringAt(c, "Kind") == "App" && c.at("Placeholder").boolValue()) << bundle;
  }
  std::set<int> widths;
  size_t invalidNames = 0;
  for (const auto& [path, entry] : snapshotTree(root + kOldApplications)) {
    invalidNames += path.find('\xFF') != std::string::npos;
    if (!path.ends_with(".app/Icon.png")) continue;
    const std::optional<platform::Image> icon = qstest::decodePNG(platform::Data(entry.begin() + 1, entry.end()));
    ASSERT_TRUE(icon) << path;
    EXPECT_EQ(icon->width, icon->height) << path;
    widths.insert(icon->width);
  }
  EXPECT_GE(widths.size(), 3u);
  EXPECT_EQ(invalidNames, 1u);
}

// Usage errors (exit 64) and an existing image (exit 1) write nothing; an
// image without applications holds only the note.
TEST_F(DevicegenCreate, RefusesUsageErrorsAndAnExistingImage) {
  const std::string root = dir_ / "never";
  for (const auto& args : std::vector<std::vector<std::string>>{{}, {"create", "--apps", "3"}, {"verify"}, {"frob"}}) {
    const RunResult run = runTool("devicegen", args);
    EXPECT_EQ(run.status, kUsageStatus) << run.err;
    EXPECT_FALSE(run.err.empty());
  }
  using Options = std::vector<std::string>;
  for (const Options& options : {Options{"--apps", "2", "--placeholders", "2", "--builtin-older", "1"},
                                 Options{"--apps", "2", "--vpn-only", "3"}, Options{"--apps", "-1"},
                                 Options{"--apps", "2", "--placeholders", "2", "--groups", "1"}}) {
    EXPECT_EQ(create(root, options).status, kUsageStatus) << options.back();
  }
  EXPECT_NE(create(root, {"--apps", "1", "--builtin-older", "2"}).err.find("exceeds --apps"), std::string::npos);
  EXPECT_FALSE(exists(root));
  ASSERT_EQ(create(root, {"--apps", "0"}).status, 0);
  EXPECT_EQ(listDirectory(root + kOldApplications), std::vector<std::string>{"WhereDidMyApplicationsGo.txt"});
  EXPECT_FALSE(exists(root + kSafeHarborMap));
  EXPECT_TRUE(arrayAt(readDictionary(root + kManifest), "Items").empty());
  const auto before = snapshotTree(root);
  const RunResult again = create(root);
  EXPECT_EQ(again.status, 1);
  EXPECT_NE(again.err.find("already holds an image"), std::string::npos) << again.err;
  EXPECT_EQ(snapshotTree(root), before);
}

}  // namespace
}  // namespace tooltest
