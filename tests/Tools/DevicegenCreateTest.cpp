// devicegen create: the images it writes, run as a program on temporary roots.
#include <sys/xattr.h>

#include <set>

#include "ToolTestSupport.h"
#include "support/ImageSupport.h"

namespace tooltest {
namespace {

// Two images with the same seed are identical apart from the absolute paths
// the install map and the safe-harbor map record; another seed gives another.
// The manifest lists what the verifier will look for: every user item of
// every container, as it lies on disk, with its size, digest or (relative)
// link text.
TEST(DevicegenCreate, SameSeedSameImageManifestListsEveryUserItemPlaceholdersMarkedIconsPNG) {
  qstest::TempDir dir("devicegen-create");
  const std::string root = dir / "first", second = dir / "second";
  ASSERT_TRUE(createImage(root).status == 0 && createImage(second).status == 0);
  auto a = snapshotTree(root);
  ASSERT_GT(a.size(), 300u);
  for (auto& [path, entry] : a) {
    for (size_t at; (at = entry.find(root + "/")) != std::string::npos;) entry.replace(at, root.size(), second);
  }
  EXPECT_TRUE(a == snapshotTree(second));  // (a difference would print both whole trees)
  std::vector<std::string> options = kStandardOptions;
  options.back() = "8";
  ASSERT_EQ(createImage(dir / "third", options).status, 0);
  EXPECT_NE(qstest::readFile(root + kManifest), qstest::readFile(dir / "third" + kManifest));

  const Dictionary m = readDictionary(root + kManifest);
  std::map<std::pair<std::string, std::string>, std::string> containers;  // (owner, identifier) -> container
  for (auto [owner, list] : {std::pair{"App", "Containers"}, {"Group", "Groups"}}) {
    for (const Value& v : arrayAt(m, list))
      containers[{owner, stringAt(*v.asDictionary(), "Identifier")}] = stringAt(*v.asDictionary(), "Container");
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

  // Placeholder bundles carry the mark the migrator looks for; icons are PNG
  // images of several sizes; one name is not UTF-8.
  for (const Value& v : arrayAt(m, "Containers")) {
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
TEST(DevicegenCreate, RefusesUsageErrorsAndAnExistingImage) {
  qstest::TempDir dir("devicegen-create");
  const std::string root = dir / "never";
  for (const auto& args : std::vector<std::vector<std::string>>{{}, {"create", "--apps", "3"}, {"verify"}, {"frob"}})
    EXPECT_THAT(runTool("devicegen", args), exited(kUsageStatus, Not(IsEmpty()))) << PrintToString(args);
  for (const auto& [options, why] : std::vector<std::pair<std::vector<std::string>, std::string>>{
           {{"--apps", "2", "--placeholders", "2", "--builtin-older", "1"}, "exceeds --apps"},
           {{"--apps", "2", "--vpn-only", "3"}, "--vpn-only"},
           {{"--apps", "-1"}, "--apps"},
           {{"--apps", "2", "--placeholders", "2", "--groups", "1"}, "--groups"}}) {
    EXPECT_THAT(createImage(root, options), exited(kUsageStatus, HasSubstr(why)));
  }
  EXPECT_FALSE(exists(root));
  ASSERT_EQ(createImage(root, {"--apps", "0"}).status, 0);
  EXPECT_EQ(entries(root + kOldApplications), std::vector<std::string>{"WhereDidMyApplicationsGo.txt"});
  EXPECT_FALSE(exists(root + kSafeHarborMap));
  EXPECT_TRUE(arrayAt(readDictionary(root + kManifest), "Items").empty());
  const auto before = snapshotTree(root);
  EXPECT_THAT(createImage(root), exited(1, HasSubstr("already holds an image")));
  EXPECT_EQ(snapshotTree(root), before);
}

}  // namespace
}  // namespace tooltest
