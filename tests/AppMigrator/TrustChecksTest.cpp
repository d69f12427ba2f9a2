// What the run refuses to take from places it does not control: group
// containers the install map puts where they do not belong, identifiers that
// two containers claim, and items another container already moved.
#include "FakePlatform.h"

namespace qstest {
namespace {

class TrustChecks : public MigratorTest {};

TEST_F(TrustChecks, GroupContainersOutsideTheirPlaceAreLeftAlone) {
  QSGlobalConfiguration& configuration = QSGlobalConfiguration::sharedInstance();
  const std::string builtIn = configuration.systemAppsDirectory().path() + "/Built.app";
  const std::string groups = scratch_->path() + "/OldGroups";
  const struct {
    std::string path;
    const char* reason;
  } kCases[] = {
      {"/", "the path does not lie inside the system root"},
      {systemRoot(), "the path does not lie inside the system root"},
      {"/tmp", "the path does not lie inside the system root"},
      {systemRoot() + "/private/var", "the path holds directories of the system's layout"},
      {oldApplicationsPath(), "the path lies inside an application's container"},
      {oldApplicationsPath() + "/C1/Documents", "the path lies inside an application's container"},
      {builtIn, "the path lies inside an application's container"},
      {configuration.dataContainersPath().path() + "/Data/Application/X", "the path lies inside an application's"},
      {groups, "the path holds another group's container"},
      {groups + "/../OldGroups/b", "the path does not lie inside the system root"},
  };
  makeContainer("C1");
  ASSERT_TRUE(makeDirs(oldApplicationsPath() + "/C1/Documents") && makeDirs(builtIn) && makeDirs(groups + "/b"));
  Dictionary map{{"group.b", Value(Dictionary{{"Container", Value(groups + "/b")}})}};
  for (size_t i = 0; i < std::size(kCases); ++i) {
    map["group." + std::to_string(i)] = Value(Dictionary{{"Container", Value(kCases[i].path)}});
  }
  writeInstallMap(Dictionary{{"GroupContainers", Value(map)}});
  ASSERT_TRUE(makeMigrator());
  for (size_t i = 0; i < std::size(kCases); ++i) {
    const std::string group = "group." + std::to_string(i);
    SCOPED_TRACE(kCases[i].path);
    log_->clear();
    EXPECT_FALSE(migrator_->_groupContainerPathIsAcceptable(URL::fileURL(kCases[i].path, true), group));
    EXPECT_TRUE(loggedOnce("QSAppMigrator: Not migrating group container " + group + " at " + kCases[i].path + " : " +
                               kCases[i].reason,
                           true));
  }
  EXPECT_TRUE(migrator_->_groupContainerPathIsAcceptable(URL::fileURL(groups + "/b", true), "group.b"));
  std::filesystem::remove_all(builtIn);
}

TEST_F(TrustChecks, SecondContainerClaimingAnIdentifierIsKeptUntouched) {
  // Two applications and a VPN-only plug-in claiming one identifier, and a
  // marker naming a built-in application's.
  const std::string builtIn = QSGlobalConfiguration::sharedInstance().systemAppsDirectory().path() + "/Built.app";
  makeBundle(builtIn, "com.example.builtin");
  QSGlobalConfiguration::sharedInstance().reScanSystemApps();
  for (const std::string name : {"a1", "a2", "vpn", "marked"}) {
    const std::string container = makeContainer(name);
    ASSERT_TRUE(makeDirs(container + "/Documents") && writeFile(container + "/Documents/" + name, name));
  }
  makeBundle(oldApplicationsPath() + "/a1/Same.app", "com.example.same");
  makeBundle(oldApplicationsPath() + "/a2/Same.app", "com.example.same");
  makeBundle(oldApplicationsPath() + "/vpn/Tunnel.vpnplugin", "com.example.same");
  const std::string marked = oldApplicationsPath() + "/marked";
  writePlist(marked + "/com.vantrel.quill.set.container_migrator.plist",
             Value(containerInfo(marked, marked + "/Built.app", "com.example.builtin", "App")));
  writeInstallMap();
  ASSERT_TRUE(makeMigrator());
  EXPECT_FALSE(migrator_->performMigration());

  // Exactly one of the applications moved; the other two claimants are whole.
  const std::vector<std::string> moved = directoryNames(platform_->registry.dataContainerPath("com.example.same") +
                                                        "/Documents");
  ASSERT_EQ(moved.size(), 1u);
  for (const std::string name : {"a1", "a2", "vpn"}) {
    if (name == moved.front()) continue;
    EXPECT_EQ(readFile(oldApplicationsPath() + "/" + name + "/Documents/" + name), name);
    EXPECT_TRUE(loggedOnce("QSAppMigrator: Not migrating container " + oldApplicationsPath() + "/" + name +
                           " : another container of this run was already migrated as com.example.same"));
  }
  EXPECT_EQ(readFile(marked + "/Documents/marked"), "marked");
  EXPECT_TRUE(loggedOnce("QSAppMigrator: Migration marker " + marked +
                         "/com.vantrel.quill.set.container_migrator.plist names the built-in application "
                         "com.example.builtin ; keeping container " + marked));
  std::filesystem::remove_all(builtIn);
  QSGlobalConfiguration::sharedInstance().reScanSystemApps();
}

TEST_F(TrustChecks, ItemMovedInThisRunIsNeverReplacedByAnotherContainers) {
  ASSERT_TRUE(makeMigrator());
  const std::string first = makeContainer("first"), second = makeContainer("second");
  const std::string target = scratch_->path() + "/data";
  for (const std::string& c : {first, second}) {
    ASSERT_TRUE(makeDirs(c + "/Documents") && writeFile(c + "/Documents/f", c));
  }
  ASSERT_TRUE(makeDirs(target));
  const URL to = URL::fileURL(target, true);
  EXPECT_TRUE(migrator_->_migrateDataContainerForIdentifier("id", URL::fileURL(first, true), to));
  EXPECT_FALSE(migrator_->_migrateDataContainerForIdentifier("id", URL::fileURL(second, true), to));
  EXPECT_EQ(readFile(target + "/Documents/f"), first);
  EXPECT_EQ(readFile(second + "/Documents/f"), second);
  EXPECT_TRUE(loggedOnce("QSAppMigrator: Not replacing " + target + "/Documents : another container moved it there "
                         "in this run"));
}

}  // namespace
}  // namespace qstest
