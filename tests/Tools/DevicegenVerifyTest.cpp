// devicegen verify: run as a program on images migrated by transvale (which
// the full build makes), then damaged.
#include <unistd.h>

#include "ToolTestSupport.h"

namespace tooltest {
namespace {

// Before the migration the image fails, listing what is left and not
// installed, in text and in JSON; after it, it passes; then each damage is reported as exactly
// the problem it is, and an unreadable manifest fails the verification.
TEST(DevicegenVerify, UnmigratedFailsMigratedPassesAndEachDamageIsReportedPrecisely) {
  qstest::TempDir dir("devicegen-verify");
  const std::string root_ = dir / "image";
  ASSERT_EQ(createImage(root_).status, 0);
  auto verify = [&](int status, const std::vector<std::string>& lines) {
    const RunResult run = runTool("devicegen", {"verify", "--root", root_});
    EXPECT_THAT(run, exited(status));
    for (const std::string& line : lines) EXPECT_THAT(run.out, HasSubstr(line));
  };
  verify(1, {"left behind: old applications directory " + root_ + kOldApplications,
             "registry: not installed: com.example.", "version: no last system version", "... and ", "FAILED"});
  EXPECT_THAT(runTool("devicegen", {"verify", "--json", "--root", root_}),  // the same verdict, as one document
              exited(1, _,
                     AllOf(StartsWith("{\"root\":\""), EndsWith("}\n"), Not(HasSubstr("\"left behind\":0")),
                           HasSubstr("\"ok\":false,\"fatal\":null,\"summary\":{\"applications\":8,"))));
  EXPECT_THAT(runTool("devicegen", {"verify", "--root", dir / "absent"}),  // a failure, not a usage error
              exited(1, HasSubstr("realpath " + (dir / "absent"))));

  const RunResult migration = runTool("transvale", {"--root", root_, "--progress", "never", "--log", dir / "log"});
  ASSERT_THAT(migration, exited(0)) << qstest::readFile(dir / "log");
  verify(0, {"OK: "});
  auto registry = platform::SQLiteApplicationRegistry::open(root_);
  ASSERT_TRUE(registry);
  const Dictionary manifest = readDictionary(root_ + kManifest);
  // Where the items of a kind now are, with their owners, in manifest order.
  auto items = [&](const std::string& owner, const char* kind) {
    std::vector<std::pair<std::string, std::string>> found;
    for (const Value& v : arrayAt(manifest, "Items")) {
      const Dictionary& item = *v.asDictionary();
      const std::string id = stringAt(item, "Identifier");
      if (stringAt(item, "Owner") != owner || stringAt(item, "Kind") != kind || !item.count("Path")) continue;
      std::string base;  // a group's one container is named by each member's record
      for (const platform::BundleRecord& r : registry->allRecords()) {
        if (owner == "App" && r.identifier == id) base = r.dataContainerURL->path();
        if (owner == "Group" && r.groupContainerURLs && r.groupContainerURLs->count(id))
          base = r.groupContainerURLs->at(id).path();
      }
      found.push_back({id, base + "/" + stringAt(item, "Path")});
    }
    return found;
  };
  const auto files = items("App", "File");
  const auto link = items("App", "Link").at(0).second;
  const auto [group, groupFile] = items("Group", "File").at(0);
  ASSERT_GE(files.size(), 3u);
  const std::string bytes = qstest::readFile(files[0].second), kept = qstest::readFile(files[1].second);
  const std::string changed = std::string(1, static_cast<char>(bytes.at(0) ^ 0x5A)) + bytes.substr(1);
  Dictionary version = readDictionary(root_ + kSystemVersion);
  version["BuildVersion"] = "1A1";
  std::string oldGroup;
  for (const Value& v : arrayAt(manifest, "Groups")) {
    if (stringAt(*v.asDictionary(), "Identifier") == group) oldGroup = stringAt(*v.asDictionary(), "Container");
  }
  ASSERT_TRUE(qstest::writeFile(files[0].second, changed) && truncate(files[1].second.c_str(), 1) == 0);
  ASSERT_EQ(unlink(files[2].second.c_str()) | unlink(groupFile.c_str()) | unlink(link.c_str()), 0);
  ASSERT_EQ(symlink("elsewhere", link.c_str()), 0);
  ASSERT_TRUE(platform::plist::writeFile(version, platform::URL::fileURL(root_ + kLastSystemVersion)));
  ASSERT_TRUE(qstest::makeDirs(root_ + "/" + oldGroup) && qstest::writeFile(root_ + kInstallMap, "x") &&
              qstest::writeFile(root_ + kSafeHarborMap, "x") && qstest::makeDirs(root_ + kOldApplications + "/OLD"));
  verify(1, {"problems: 11 (missing 2, changed 3, left behind 5, version 1)",
             "changed: " + files[0].second + ": content differs (SHA-256 " + sha256Hex(changed),
             "changed: " + files[1].second + ": 1 bytes, expected " + std::to_string(kept.size()),
             "missing: " + files[2].second + " (data of " + files[2].first + ")",
             "missing: " + groupFile + " (group " + group + ")", "changed: " + link + ": link reads \"elsewhere\"",
             "1A1", "left behind: old applications directory " + root_ + kOldApplications + " (1 entries)",
             "left behind: old container " + root_ + kOldApplications + "/OLD",
             "left behind: old install map " + root_ + kInstallMap,
             "left behind: safe-harbor map " + root_ + kSafeHarborMap,
             "left behind: old group container of " + group + ": " + root_ + "/" + oldGroup});

  ASSERT_TRUE(qstest::writeFile(root_ + kManifest, "<plist>not a manifest"));
  verify(1, {"FAILED: cannot read the manifest " + root_ + kManifest});
}

}  // namespace
}  // namespace tooltest
