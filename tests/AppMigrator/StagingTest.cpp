// Staging of an old container's bundle into a package and its installation,
// with the registry's progress reports delivered on a thread of its own.
#include "FakePlatform.h"

using platform::Dictionary;
using platform::URL;
using platform::Value;

namespace qstest {
namespace {

constexpr char kIdentifier[] = "com.example.writer";

Dictionary errorReport(const std::string& name, const std::string& description, const std::string& detail) {
  return Dictionary{{platform::kRegistryProgressErrorKey, Value(name)},
                    {platform::kRegistryProgressErrorDescriptionKey, Value(description)},
                    {platform::kRegistryProgressErrorDetailKey, Value(detail)}};
}

class BundleStaging : public MigratorTest {
 protected:
  void SetUp() override {
    MigratorTest::SetUp();
    container_ = makeContainer("C1");
    bundle_ = container_ + "/Writer.app";
    plugin_ = container_ + "/Tunnel.vpnplugin";
    makeBundle(bundle_, kIdentifier);
    migrator_ = createMigrator();
    ASSERT_TRUE(migrator_);
    log_->clear();
  }
  bool stage(bool withPlugin = false) {
    return migrator_->_stageAndInstallBundleAtURL(
        URL::fileURL(bundle_, true), kIdentifier,
        withPlugin ? std::optional(URL::fileURL(plugin_, true)) : std::nullopt, URL::fileURL(container_, true));
  }
  std::string packagePath() const { return container_ + "/Staging"; }
  std::string alreadyInstalledLine() const {
    return "QSAppMigrator: Installation of " + bundle_ +
           " failed because it's older than what's built into the system. Data migration already happened so we're "
           "done here.";
  }

  std::string container_, bundle_, plugin_;
  std::unique_ptr<QSAppMigrator> migrator_;
};

TEST_F(BundleStaging, PackageHoldsBundlesAndStoreDataAndIsInstalledWithFiveOptions) {
  makeBundle(plugin_, "com.example.writer.tunnel");
  ASSERT_TRUE(writeFile(container_ + "/Manifest.plist", "m") && writeFile(container_ + "/VendraMetadata.plist", "v"));
  ASSERT_TRUE(makeDirs(container_ + "/VendraArtwork") && makeDirs(container_ + "/Documents"));
  std::vector<std::string> package, payload, containerAtInstall;
  platform_->registry.observer = [&](const std::string& call, const std::string&) {
    if (call != "installPackage") return;
    package = directoryNames(packagePath());
    payload = directoryNames(packagePath() + "/Payload");
    containerAtInstall = directoryNames(container_);
  };
  ASSERT_TRUE(stage(true));
  // The bundles were moved, not copied, into Payload; user data is not the staging's business.
  EXPECT_EQ(payload, (std::vector<std::string>{"Tunnel.vpnplugin", "Writer.app"}));
  EXPECT_EQ(package, (std::vector<std::string>{"Manifest.plist", "Payload", "VendraArtwork", "VendraMetadata.plist"}));
  EXPECT_EQ(containerAtInstall, (std::vector<std::string>{"Documents", "Staging"}));

  const auto calls = platform_->registry.installCalls;
  ASSERT_EQ(calls.size(), 1u);
  EXPECT_EQ(calls[0].location.path(), packagePath());
  const Dictionary expected{
      {platform::kRegistryInstallTypeKey, Value(uint64_t{6})},
      {platform::kRegistryPackageTypeKey, Value(platform::kRegistryPackageTypeCustomer)},
      {"VerifyForMigrator", Value(true)},
      {"SkipBlacklist", Value(true)},
      {platform::kBundleIdentifierKey, Value(kIdentifier)},
  };
  EXPECT_EQ(Value(calls[0].options), Value(expected));
  EXPECT_EQ(calls[0].options.at(platform::kRegistryInstallTypeKey).type(), Value::Type::Unsigned);
  EXPECT_TRUE(log_->hostLines().empty());
}

TEST_F(BundleStaging, PayloadOrMoveFailureStopsBeforeTheRegistryIsAsked) {
  makeBundle(plugin_, "com.example.writer.tunnel");
  const std::pair<std::string, std::string> cases[] = {
      {container_, "QSAppMigrator: Failed to create file://" + packagePath() + "/Payload/ : "},
      {bundle_, "QSAppMigrator: Failed to move bundle from file://" + bundle_ + "/ to file://" + packagePath() +
                    "/Payload/Writer.app/: Error Domain="},
      {plugin_, "QSAppMigrator: Failed to move vpn bundle from file://" + plugin_ + "/ to file://" + packagePath() +
                    "/Payload/Tunnel.vpnplugin/: Error Domain="},
  };
  for (const auto& [immutable, line] : cases) {
    makeImmutable(immutable);
    log_->clear();
    EXPECT_FALSE(stage(true));
    ASSERT_TRUE(setImmutable(immutable, false));
    immutable_.pop_back();
    EXPECT_EQ(log_->hostMessages().size(), 1u);
    EXPECT_TRUE(loggedOnce(line, true));
  }
  EXPECT_TRUE(platform_->registry.installCalls.empty());
  EXPECT_EQ(directoryNames(packagePath() + "/Payload"), std::vector<std::string>{"Writer.app"});
}

TEST_F(BundleStaging, AlreadyInstalledRefusalIsSuccessEvenAfterALaterErrorReport) {
  platform_->registry.alreadyInstalledOf.insert(kIdentifier);
  EXPECT_TRUE(stage());
  EXPECT_EQ(log_->hostMessages(), std::vector<std::string>{alreadyInstalledLine()});

  // The flag, once raised, is not cleared by a report that follows.
  platform_->registry.alreadyInstalledOf.clear();
  platform_->registry.refuseInstallOf.insert(kIdentifier);
  platform_->registry.reportsFirst = {errorReport("ApplicationAlreadyInstalled", "older", "built in")};
  log_->clear();
  EXPECT_TRUE(stage());
  EXPECT_EQ(log_->hostMessages(),
            (std::vector<std::string>{alreadyInstalledLine(),
                                      "QSAppMigrator: Installation of " + bundle_ +
                                          " failed with Quillset error refused by the test (InstallFailed : (null))"}));
}

TEST_F(BundleStaging, ErrorReportsAreLoggedButOnlyTheInstallResultDecides) {
  platform_->registry.reportsFirst = {errorReport("Warning", "transient", "retried"),
                                      Dictionary{{platform::kRegistryProgressPercentKey, Value(10)}}};
  EXPECT_TRUE(stage());
  EXPECT_EQ(log_->hostMessages(),
            std::vector<std::string>{"QSAppMigrator: Installation of " + bundle_ +
                                     " failed with Quillset error transient (Warning : retried)"});

  makeBundle(bundle_, kIdentifier);
  platform_->registry.reportsFirst = {errorReport("PackageCorrupt", "bad package", "no Info.plist")};
  platform_->registry.refuseInstallOf.insert(kIdentifier);
  log_->clear();
  EXPECT_FALSE(stage());
  const auto messages = log_->hostMessages();
  ASSERT_EQ(messages.size(), 3u);
  EXPECT_EQ(messages[0], "QSAppMigrator: Installation of " + bundle_ +
                             " failed with Quillset error bad package (PackageCorrupt : no Info.plist)");
  EXPECT_EQ(messages[2].rfind(
                "QSAppMigrator: Failed to install file://" + packagePath() + "/ : Error Domain=" + kFakeErrorDomain, 0),
            0u)
      << messages[2];
}

}  // namespace
}  // namespace qstest
