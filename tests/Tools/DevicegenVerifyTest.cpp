// devicegen verify: run as a program on images migrated through the real
// registry, then damaged in one precise way each.
#include <sys/stat.h>
#include <unistd.h>

#include <functional>

#include <gtest/gtest.h>

#include "MigrationSimulator.h"
#include "Platform/Foundation/PropertyList.h"
#include "Platform/Registry/SQLiteRegistry.h"
#include "ToolTestSupport.h"
#include "support/TestSupport.h"

namespace {

using platform::Dictionary;
using platform::Value;

class DevicegenVerify : public ::testing::Test {
 protected:
  void SetUp() override {
    root_ = dir_ / "image";
    const tooltest::RunResult run =
        tooltest::runTool("devicegen", {"create", "--root",    root_, "--apps",          "6", "--vpn-only",
                                        "1",      "--groups",  "3",   "--files-per-app", "5", "--bytes-per-file",
                                        "700",    "--harbors", "2",   "--placeholders",  "1", "--builtin-older",
                                        "1",      "--seed",    "11"});
    ASSERT_EQ(run.status, 0) << run.err;
  }

  void migrate() {
    const std::string failed = tooltest::simulateMigration(root_);
    ASSERT_EQ(failed, "");
  }
  tooltest::RunResult verify() { return tooltest::runTool("devicegen", {"verify", "--root", root_}); }

  // Where the registry put the data of `identifier`.
  std::string dataContainer(const std::string& identifier) {
    auto registry = platform::SQLiteApplicationRegistry::open(root_);
    auto record = registry ? registry->recordForIdentifier(identifier) : std::nullopt;
    EXPECT_TRUE(record && record->dataContainerURL) << identifier;
    return record && record->dataContainerURL ? record->dataContainerURL->path() : "";
  }
  // The first application item of the manifest of the given kind, with its
  // owner.
  std::pair<std::string, std::string> firstItem(const char* kind) {
    const Dictionary m = tooltest::readDictionary(root_ + tooltest::kManifest);
    for (const Value& v : tooltest::arrayAt(m, "Items")) {
      const Dictionary& item = *v.asDictionary();
      if (tooltest::stringAt(item, "Owner") == "App" && tooltest::stringAt(item, "Kind") == kind &&
          item.count("Path")) {
        return {tooltest::stringAt(item, "Identifier"), tooltest::stringAt(item, "Path")};
      }
    }
    ADD_FAILURE() << "no " << kind << " in the manifest";
    return {};
  }
  static size_t count(const std::string& text, const std::string& what) {
    size_t n = 0;
    for (size_t at = text.find(what); at != std::string::npos; at = text.find(what, at + 1)) ++n;
    return n;
  }

  qstest::TempDir dir_{"devicegen-verify"};
  std::string root_;
};

TEST_F(DevicegenVerify, MigratedImagePassesWithSummary) {
  migrate();
  const tooltest::RunResult run = verify();
  EXPECT_EQ(run.status, 0) << run.out << run.err;
  EXPECT_NE(run.out.find("applications: 6 (1 placeholders, 1 kept as built-in), VPN-only containers: 1, groups: 3, "
                         "safe harbors: 2"),
            std::string::npos)
      << run.out;
  EXPECT_NE(run.out.find("files: "), std::string::npos);
  EXPECT_NE(run.out.find("OK: "), std::string::npos);
}

TEST_F(DevicegenVerify, UnmigratedImageFailsListingWhatIsLeftAndNotInstalled) {
  const tooltest::RunResult run = verify();
  EXPECT_EQ(run.status, 1);
  EXPECT_NE(run.out.find("left behind: old applications directory " + root_ + tooltest::kOldApplications),
            std::string::npos)
      << run.out;
  EXPECT_NE(run.out.find("registry: not installed: com.example."), std::string::npos) << run.out;
  EXPECT_NE(run.out.find("version: no last system version"), std::string::npos) << run.out;
  // The list is bounded; the rest is counted.
  EXPECT_NE(run.out.find("... and "), std::string::npos) << run.out;
  EXPECT_NE(run.out.find("FAILED"), std::string::npos);
}

TEST_F(DevicegenVerify, ChangedTruncatedRemovedOrRetargetedItemIsReported) {
  migrate();
  const auto [owner, path] = firstItem("File");
  const std::string file = dataContainer(owner) + "/" + path;
  const std::string bytes = qstest::readFile(file);
  ASSERT_FALSE(bytes.empty());
  std::string changed = bytes;
  changed[0] = static_cast<char>(changed[0] ^ 0x5A);  // same size, other content
  const auto [linkOwner, linkPath] = firstItem("Link");
  const std::string link = dataContainer(linkOwner) + "/" + linkPath;
  const std::string target = tooltest::snapshotTree(dataContainer(linkOwner))[linkPath].content;
  const struct {
    std::function<bool()> damage, repair;
    std::string problems, line;
  } cases[] = {
      {[&] { return qstest::writeFile(file, changed); }, [&] { return qstest::writeFile(file, bytes); },
       "problems: 1 (changed 1)", "changed: " + file + ": content differs (SHA-256 " + tooltest::sha256Hex(changed)},
      {[&] { return truncate(file.c_str(), 1) == 0; }, [&] { return qstest::writeFile(file, bytes); },
       "problems: 1 (changed 1)", "changed: " + file + ": 1 bytes, expected " + std::to_string(bytes.size())},
      {[&] { return unlink(file.c_str()) == 0; }, [&] { return qstest::writeFile(file, bytes); },
       "problems: 1 (missing 1)", "missing: " + file + " (data of " + owner + ")"},
      {[&] { return unlink(link.c_str()) == 0 && symlink("elsewhere", link.c_str()) == 0; },
       [&] { return unlink(link.c_str()) == 0 && symlink(target.c_str(), link.c_str()) == 0; },
       "problems: 1 (changed 1)", "changed: " + link + ": link reads \"elsewhere\""},
  };
  for (const auto& c : cases) {
    ASSERT_TRUE(c.damage()) << c.line;
    const tooltest::RunResult run = verify();
    EXPECT_EQ(run.status, 1);
    EXPECT_NE(run.out.find(c.problems), std::string::npos) << run.out;
    EXPECT_NE(run.out.find(c.line), std::string::npos) << run.out;
    ASSERT_TRUE(c.repair()) << c.line;
  }
  EXPECT_EQ(verify().status, 0) << "every damage was repaired";
}

TEST_F(DevicegenVerify, FileMissingFromASharedGroupContainerIsReported) {
  migrate();
  // A group of three applications has one new container, found through any
  // member's record.
  const Dictionary m = tooltest::readDictionary(root_ + tooltest::kManifest);
  const Dictionary& group = *tooltest::arrayAt(m, "Groups")[0].asDictionary();
  ASSERT_EQ(tooltest::arrayAt(group, "Members").size(), 3u);
  const std::string identifier = tooltest::stringAt(group, "Identifier");
  auto registry = platform::SQLiteApplicationRegistry::open(root_);
  ASSERT_TRUE(registry);
  const auto member = registry->recordForIdentifier(*tooltest::arrayAt(group, "Members")[2].asString());
  ASSERT_TRUE(member && member->groupContainerURLs && member->groupContainerURLs->count(identifier));
  std::string relative;
  for (const Value& v : tooltest::arrayAt(m, "Items")) {
    const Dictionary& item = *v.asDictionary();
    if (tooltest::stringAt(item, "Identifier") == identifier && tooltest::stringAt(item, "Kind") == "File") {
      relative = tooltest::stringAt(item, "Path");
      break;
    }
  }
  const std::string file = member->groupContainerURLs->at(identifier).path() + "/" + relative;
  ASSERT_EQ(unlink(file.c_str()), 0) << file;
  const tooltest::RunResult run = verify();
  EXPECT_EQ(run.status, 1);
  EXPECT_NE(run.out.find("problems: 1 (missing 1)"), std::string::npos) << run.out;
  EXPECT_NE(run.out.find("missing: " + file + " (group " + identifier + ")"), std::string::npos) << run.out;
}

TEST_F(DevicegenVerify, LeftoversOfTheOldLayoutAreReported) {
  migrate();
  const Dictionary m = tooltest::readDictionary(root_ + tooltest::kManifest);
  const std::string oldGroup =
      root_ + "/" + tooltest::stringAt(*tooltest::arrayAt(m, "Groups")[0].asDictionary(), "Container");
  ASSERT_TRUE(qstest::makeDirs(oldGroup));
  ASSERT_TRUE(qstest::writeFile(root_ + tooltest::kInstallMap, "x"));
  ASSERT_TRUE(qstest::writeFile(root_ + tooltest::kSafeHarborMap, "x"));
  ASSERT_TRUE(qstest::makeDirs(root_ + tooltest::kOldApplications + "/LEFTOVER"));
  const tooltest::RunResult run = verify();
  EXPECT_EQ(run.status, 1);
  EXPECT_NE(run.out.find("problems: 5 (left behind 5)"), std::string::npos) << run.out;
  EXPECT_NE(
      run.out.find("left behind: old applications directory " + root_ + tooltest::kOldApplications + " (1 entries)"),
      std::string::npos)
      << run.out;
  EXPECT_NE(run.out.find("left behind: old container " + root_ + tooltest::kOldApplications + "/LEFTOVER"),
            std::string::npos);
  EXPECT_NE(run.out.find("left behind: old install map " + root_ + tooltest::kInstallMap), std::string::npos);
  EXPECT_NE(run.out.find("left behind: safe-harbor map " + root_ + tooltest::kSafeHarborMap), std::string::npos);
  EXPECT_NE(run.out.find("left behind: old group container of group.com.example."), std::string::npos);
}

TEST_F(DevicegenVerify, DifferentLastSystemVersionIsReported) {
  migrate();
  Dictionary version = tooltest::readDictionary(root_ + tooltest::kSystemVersion);
  version["BuildVersion"] = "1A1";
  ASSERT_TRUE(platform::plist::writeFile(version, platform::URL::fileURL(root_ + tooltest::kLastSystemVersion)));
  const tooltest::RunResult run = verify();
  EXPECT_EQ(run.status, 1);
  EXPECT_NE(run.out.find("problems: 1 (version 1)"), std::string::npos) << run.out;
  EXPECT_NE(run.out.find("1A1"), std::string::npos) << run.out;
}

TEST_F(DevicegenVerify, UnreadableManifestFailsClearly) {
  migrate();
  ASSERT_TRUE(qstest::writeFile(root_ + tooltest::kManifest, "<plist>not a manifest"));
  const tooltest::RunResult run = verify();
  EXPECT_EQ(run.status, 1);
  EXPECT_NE(run.out.find("FAILED: cannot read the manifest " + root_ + tooltest::kManifest), std::string::npos)
      << run.out;
}

TEST_F(DevicegenVerify, MissingRootIsAFailureNotAUsageError) {
  const tooltest::RunResult run = tooltest::runTool("devicegen", {"verify", "--root", dir_ / "absent"});
  EXPECT_EQ(run.status, 1);
  EXPECT_NE(run.err.find("realpath " + (dir_ / "absent")), std::string::npos) << run.err;
}

}  // namespace
