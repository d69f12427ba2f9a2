// Introspection of old containers and the migration marker.
#include <sys/stat.h>

#include "FakePlatform.h"

namespace qstest {
namespace {

constexpr char kMarkerName[] = "com.vantrel.quill.set.container_migrator.plist";

class Introspection : public MigratorTest {
 protected:
  void SetUp() override {
    MigratorTest::SetUp();
    ASSERT_TRUE(makeMigrator());
    // Made after creation, which would remove it while empty.
    ASSERT_TRUE(makeDirs(oldApplicationsPath()));
  }
  // The description, with the early flag in *early (set to `initial` first).
  std::optional<Dictionary> introspect(const std::string& path, bool* early = nullptr, bool initial = false) {
    bool flag = initial;
    auto info = migrator_->_introspectContainer(URL::fileURL(path, true), &flag);
    if (early) *early = flag;
    return info;
  }
  static std::string markerLoadFailedLine(const std::string& path) {
    return "QSAppMigrator: Failed to load migration marker file from file://" + path;
  }

};

TEST_F(Introspection, ContainerThatCannotBeLookedIntoIsLeftInPlace) {
  // Unlistable (no read permission), and listable but not searchable, so that
  // the status of a child cannot be read.
  const std::string locked = makeBundleContainer("locked", "com.example.a");
  const std::string unsearchable = makeBundleContainer("unsearchable", "com.example.b");
  ASSERT_EQ(chmod(locked.c_str(), 0700), 0);
  ASSERT_EQ(chmod(unsearchable.c_str(), 0744), 0);
  const int status = runAsNobody([&] {
    log_->clear();
    const bool none = !introspect(locked) && !introspect(unsearchable);
    const bool logged =
        loggedOnce("QSAppMigrator: Failed to get URLs in container " + locked + " : Error Domain=POSIXErrorDomain Code=13 ",
                   true) &&
        loggedOnce("QSAppMigrator: Failed to stat path " + unsearchable + "/com.example.b.app : Permission denied");
    return none && logged ? 0 : 1;
  });
  EXPECT_EQ(status, 0);
  EXPECT_TRUE(pathExists(locked + "/com.example.a.app"));
  EXPECT_TRUE(pathExists(unsearchable + "/com.example.b.app"));
}

TEST_F(Introspection, SymbolicLinkedBundleOrMarkerLeavesContainerUntouched) {
  const std::pair<std::string, std::string> cases[] = {
      {"Tunnel.vpnplugin", "QSAppMigrator: VPN plugin was symlink; skipping container "},
      {kMarkerName, "QSAppMigrator: Migration marker was symlink; skipping container "},
  };
  makeBundle(scratch_->path() + "/Real.app", "com.example.real");
  for (const auto& [name, line] : cases) {
    const std::string container = makeContainer("link-" + name);
    ASSERT_TRUE(makeDirs(container + "/Documents"));
    ASSERT_EQ(symlink((scratch_->path() + "/Real.app").c_str(), (container + "/" + name).c_str()), 0);
    EXPECT_FALSE(introspect(container).has_value()) << name;
    EXPECT_TRUE(pathExists(container + "/" + name));
    EXPECT_TRUE(pathExists(container + "/Documents"));
    EXPECT_TRUE(loggedOnce(line + container + "/" + name));
  }
}

TEST_F(Introspection, AValidMarkerWinsOverTheChildrenAnInvalidOneLeavesThemTheDecision) {
  // Recorded elsewhere on purpose: the marker's paths are passed on unchanged.
  const std::string container = makeBundleContainer("marked", "com.example.main");
  const std::string markerPath = container + "/" + kMarkerName;
  Dictionary marker = containerInfo("/elsewhere", "/elsewhere/Tunnel.vpnplugin", "com.example.other", "VPNBundle");
  marker["Extra"] = Value(7);
  writePlist(markerPath, Value(marker));
  bool early = true;
  EXPECT_EQ(introspect(container, &early, true), marker);
  EXPECT_FALSE(early);

  const Dictionary fromChildren =
      containerInfo(container, container + "/com.example.main.app", "com.example.main", "App");
  marker["SecondBundlePath"] = Value(5);
  writePlist(markerPath, Value(marker));
  EXPECT_EQ(introspect(container), fromChildren);
  EXPECT_TRUE(loggedOnce("QSAppMigrator: Second bundle path was not a string: 5"));
  EXPECT_TRUE(loggedOnce(markerLoadFailedLine(markerPath)));

  // Every required key must hold a string.
  marker.erase("SecondBundlePath");
  marker["BundleIdentifier"] = Value(1);
  writePlist(markerPath, Value(marker));
  EXPECT_EQ(introspect(container), fromChildren);
  EXPECT_TRUE(loggedOnce("QSAppMigrator: Failed to get container bundle ID from migration marker file " + markerPath));

  // Unreadable, in a container whose application has no identifier (so no
  // bundle): removed like any other, with its data.
  const std::string garbage = makeContainer("garbage");
  ASSERT_TRUE(writeFile(garbage + "/" + kMarkerName, "garbage"));
  makeBundle(garbage + "/Main.app", "");
  ASSERT_TRUE(makeDirs(garbage + "/Documents"));
  EXPECT_FALSE(introspect(garbage).has_value());
  EXPECT_FALSE(pathExists(garbage));
  // Once from the loader, once from introspection.
  EXPECT_EQ(log_->count(markerLoadFailedLine(garbage + "/" + kMarkerName)), 2u);
  EXPECT_TRUE(loggedOnce("QSAppMigrator: No app or vpn bundle found in container " + garbage + " ; removing it"));
}

// The survey (what a dry run uses) finds what introspection finds and
// removes nothing; introspection then acts on it.
TEST_F(Introspection, SurveyFindsWithoutRemovingWhatIntrospectionRemoves) {
  using Finding = QSEntrySurvey::Finding;
  const std::string stray = oldApplicationsPath() + "/stray";
  ASSERT_TRUE(writeFile(stray, "x"));
  const std::string empty = makeContainer("empty");
  ASSERT_TRUE(makeDirs(empty + "/Documents"));
  const std::string both = makeBundleContainer("both", "com.example.app");
  makeBundle(both + "/Tunnel.vpnplugin", "com.example.app.tunnel");
  const std::string vpn = makeContainer("vpn");
  makeBundle(vpn + "/Tunnel.vpnplugin", "com.example.other.tunnel");
  const struct {
    std::string path;
    Finding finding;
    bool early;
    bool removed;
  } cases[] = {
      {stray, Finding::StrayFile, false, true},
      {empty, Finding::NoBundle, false, true},
      {both, Finding::Container, true, false},
      {vpn, Finding::Container, false, false},
      {oldApplicationsPath() + "/vanished", Finding::Vanished, false, false},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.path);
    const QSEntrySurvey survey = migrator_->_surveyEntry(URL::fileURL(c.path, true));
    EXPECT_EQ(survey.finding, c.finding);
    EXPECT_EQ(survey.orderEarly, c.early);
    EXPECT_EQ(pathExists(c.path), c.path.find("vanished") == std::string::npos) << "the survey removed it";
    bool early = false;
    const auto info = introspect(c.path, &early, !c.early);
    EXPECT_EQ(info.has_value(), c.finding == Finding::Container);
    if (info) {
      EXPECT_EQ(*info, *survey.info);
      EXPECT_EQ(early, c.early) << "the flag is set from the survey";
    }
    EXPECT_EQ(pathExists(c.path), !c.removed && c.path.find("vanished") == std::string::npos);
  }
}

}  // namespace
}  // namespace qstest
