// devicegen verify: run as a program on images migrated through the real
// registry, then damaged in one precise way each.
#include <sys/stat.h>
#include <unistd.h>

#include <functional>

#include "MigrationSimulator.h"

namespace tooltest {
namespace {

class DevicegenVerify : public ::testing::Test {
 protected:
  void SetUp() override {
    const RunResult run =
        runTool("devicegen",
                {"create", "--root",          root_, "--apps",           "6",   "--vpn-only", "1", "--groups",
                 "3",      "--files-per-app", "5",   "--bytes-per-file", "700", "--harbors",  "2", "--placeholders",
                 "1",      "--builtin-older", "1",   "--seed",           "11"});
    ASSERT_EQ(run.status, 0) << run.err;
  }
  RunResult verify() { return runTool("devicegen", {"verify", "--root", root_}); }

  qstest::TempDir dir_{"devicegen-verify"};
  const std::string root_ = dir_ / "image";
};

TEST_F(DevicegenVerify, UnmigratedImageFailsListingWhatIsLeftAndNotInstalled) {
  const RunResult run = verify();
  EXPECT_EQ(run.status, 1);
  for (const std::string& line :
       {"left behind: old applications directory " + root_ + kOldApplications,
        std::string("registry: not installed: com.example."), std::string("version: no last system version"),
        std::string("... and "), std::string("FAILED")}) {
    EXPECT_NE(run.out.find(line), std::string::npos) << line << "\n" << run.out;
  }
  const RunResult absent = runTool("devicegen", {"verify", "--root", dir_ / "absent"});
  EXPECT_EQ(absent.status, 1) << "a missing root is a failure, not a usage error";
  EXPECT_NE(absent.err.find("realpath " + (dir_ / "absent")), std::string::npos) << absent.err;
}

// Each damage to a migrated image is reported as exactly the problem it is,
// and the image verifies again once it is repaired.
TEST_F(DevicegenVerify, EachDamageIsReportedPreciselyAndRepairedImagePasses) {
  ASSERT_EQ(simulateMigration(root_), "");
  const Dictionary manifest = readDictionary(root_ + kManifest);
  const std::string manifestText = qstest::readFile(root_ + kManifest);
  auto registry = platform::SQLiteApplicationRegistry::open(root_);
  ASSERT_TRUE(registry);
  // The owner of the first application item of `kind`, and its path in the
  // new data container.
  auto firstItem = [&](const char* kind) -> std::pair<std::string, std::string> {
    for (const Value& v : arrayAt(manifest, "Items")) {
      const Dictionary& item = *v.asDictionary();
      const std::string id = stringAt(item, "Identifier");
      if (stringAt(item, "Owner") != "App" || stringAt(item, "Kind") != kind || !item.count("Path")) continue;
      return {id, registry->recordForIdentifier(id)->dataContainerURL->path() + "/" + stringAt(item, "Path")};
    }
    ADD_FAILURE() << "no " << kind;
    return {};
  };
  const auto [owner, file] = firstItem("File");
  const auto [linkOwner, link] = firstItem("Link");
  const std::string bytes = qstest::readFile(file), target = fs::read_symlink(link);
  const std::string changed = std::string(1, static_cast<char>(bytes.at(0) ^ 0x5A)) + bytes.substr(1);
  // A group of three applications has one new container, found through any
  // member's record.
  const Dictionary& group = *arrayAt(manifest, "Groups").at(0).asDictionary();
  ASSERT_EQ(arrayAt(group, "Members").size(), 3u);
  const std::string groupId = stringAt(group, "Identifier"), oldGroup = root_ + "/" + stringAt(group, "Container");
  std::string groupFile;
  for (const Value& v : arrayAt(manifest, "Items")) {
    const Dictionary& item = *v.asDictionary();
    if (groupFile.empty() && stringAt(item, "Identifier") == groupId && stringAt(item, "Kind") == "File") {
      groupFile = registry->recordForIdentifier(*arrayAt(group, "Members")[2].asString())
                      ->groupContainerURLs->at(groupId)
                      .path() +
                  "/" + stringAt(item, "Path");
    }
  }
  const std::string groupBytes = qstest::readFile(groupFile);
  Dictionary version = readDictionary(root_ + kSystemVersion);
  version["BuildVersion"] = "1A1";
  const std::string versionText = qstest::readFile(root_ + kLastSystemVersion);
  const std::string leftover = root_ + kOldApplications + "/LEFTOVER";
  const struct {
    std::function<bool()> damage, repair;
    std::vector<std::string> lines;
  } cases[] = {
      {[&] { return qstest::writeFile(file, changed); },
       [&] { return qstest::writeFile(file, bytes); },
       {"problems: 1 (changed 1)", "changed: " + file + ": content differs (SHA-256 " + sha256Hex(changed)}},
      {[&] { return truncate(file.c_str(), 1) == 0; },
       [&] { return qstest::writeFile(file, bytes); },
       {"problems: 1 (changed 1)", "changed: " + file + ": 1 bytes, expected " + std::to_string(bytes.size())}},
      {[&] { return unlink(file.c_str()) == 0; },
       [&] { return qstest::writeFile(file, bytes); },
       {"problems: 1 (missing 1)", "missing: " + file + " (data of " + owner + ")"}},
      {[&] { return unlink(link.c_str()) == 0 && symlink("elsewhere", link.c_str()) == 0; },
       [&] { return unlink(link.c_str()) == 0 && symlink(target.c_str(), link.c_str()) == 0; },
       {"problems: 1 (changed 1)", "changed: " + link + ": link reads \"elsewhere\""}},
      {[&] { return unlink(groupFile.c_str()) == 0; },
       [&] { return qstest::writeFile(groupFile, groupBytes); },
       {"problems: 1 (missing 1)", "missing: " + groupFile + " (group " + groupId + ")"}},
      {[&] { return platform::plist::writeFile(version, platform::URL::fileURL(root_ + kLastSystemVersion)); },
       [&] { return qstest::writeFile(root_ + kLastSystemVersion, versionText); },
       {"problems: 1 (version 1)", "1A1"}},
      {[&] {
         return qstest::makeDirs(oldGroup) && qstest::writeFile(root_ + kInstallMap, "x") &&
                qstest::writeFile(root_ + kSafeHarborMap, "x") && qstest::makeDirs(leftover);
       },
       [&] {
         for (const std::string& path :
              {oldGroup, root_ + kInstallMap, root_ + kSafeHarborMap, root_ + kOldApplications})
           fs::remove_all(path);
         return true;
       },
       {"problems: 5 (left behind 5)",
        "left behind: old applications directory " + root_ + kOldApplications + " (1 entries)",
        "left behind: old container " + leftover, "left behind: old install map " + root_ + kInstallMap,
        "left behind: safe-harbor map " + root_ + kSafeHarborMap, "left behind: old group container of " + groupId}},
      {[&] { return qstest::writeFile(root_ + kManifest, "<plist>not a manifest"); },
       [&] { return qstest::writeFile(root_ + kManifest, manifestText); },
       {"FAILED: cannot read the manifest " + root_ + kManifest}},
  };
  for (const auto& c : cases) {
    ASSERT_TRUE(c.damage()) << c.lines.back();
    const RunResult run = verify();
    EXPECT_EQ(run.status, 1);
    for (const std::string& line : c.lines) EXPECT_NE(run.out.find(line), std::string::npos) << line << "\n" << run.out;
    ASSERT_TRUE(c.repair()) << c.lines.back();
  }
  const RunResult run = verify();
  EXPECT_EQ(run.status, 0) << run.out;
  EXPECT_NE(run.out.find("OK: "), std::string::npos);
}

}  // namespace
}  // namespace tooltest
