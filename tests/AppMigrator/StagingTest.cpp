#include <filesystem>
#include <thread>

#include <gtest/gtest.h>

#include "FakePlatform.h"
#include "Platform/Foundation/PropertyList.h"

using platform::Dictionary;
using platform::Error;
using platform::URL;
using platform::Value;

namespace qstest {
namespace {

constexpr char kIdentifier[] = "com.example.writer";
constexpr char kStagingFunction[] =
    "-[QSAppMigrator _stageAndInstallBundleAtURL:withIdentifier:andVPNPluginAtURL:inContainerURL:]";

// Forwards to the fake registry after delivering scripted progress reports on
// a thread of its own, and notes which threads delivered reports.
class ScriptedReportsRegistry final : public platform::ApplicationRegistry {
 public:
  explicit ScriptedReportsRegistry(FakeApplicationRegistry& inner) : inner_(inner) {}
  std::vector<Dictionary> reportsBeforeInstall;
  std::vector<std::thread::id> deliveringThreads;

  bool isInstalled(const std::string& identifier) override { return inner_.isInstalled(identifier); }
  std::optional<platform::BundleRecord> recordForIdentifier(const std::string& identifier) override {
    return inner_.recordForIdentifier(identifier);
  }
  bool installPackage(const URL& package, const Dictionary& options, const platform::InstallProgressCallback& progress,
                      Error* error) override {
    auto noting = [&](const Dictionary& report) {
      deliveringThreads.push_back(std::this_thread::get_id());
      progress(report);
    };
    std::thread([&] {
      for (const Dictionary& report : reportsBeforeInstall) noting(report);
    }).join();
    return inner_.installPackage(package, options, noting, error);
  }
  bool installBundle(const URL& bundle, const Dictionary& options, Error* error) override {
    return inner_.installBundle(bundle, options, error);
  }

 private:
  FakeApplicationRegistry& inner_;
};

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
    makeBundle(bundle_, kIdentifier);
    scripted_ = std::make_unique<ScriptedReportsRegistry>(platform_->registry);
    QSMigratorServices services = platform_->services();
    services.registry = scripted_.get();
    migrator_ = QSAppMigrator::create(services);
    ASSERT_TRUE(migrator_);
    // Only the lines of the operation under test count.
    log_->clear();
  }
  void TearDown() override {
    for (const std::string& path : immutable_) setImmutable(path, false);
    MigratorTest::TearDown();
  }
  void makeImmutable(const std::string& path) {
    ASSERT_TRUE(setImmutable(path, true));
    immutable_.push_back(path);
  }
  bool stage(const std::optional<std::string>& vpnPlugin = std::nullopt) {
    std::optional<URL> plugin;
    if (vpnPlugin) plugin = URL::fileURL(*vpnPlugin, true);
    return migrator_->_stageAndInstallBundleAtURL(URL::fileURL(bundle_, true), kIdentifier, plugin,
                                                  URL::fileURL(container_, true));
  }
  std::string packagePath() const { return container_ + "/Staging"; }
  // What the package directory held when the registry was asked to install.
  void snapshotPackageAtInstall() {
    platform_->registry.observer = [this](const std::string& call, const std::string&) {
      if (call != "installPackage") return;
      packageAtInstall_ = directoryNames(packagePath());
      payloadAtInstall_ = directoryNames(packagePath() + "/Payload");
      containerAtInstall_ = directoryNames(container_);
    };
  }

  std::string container_;
  std::string bundle_;
  std::unique_ptr<ScriptedReportsRegistry> scripted_;
  std::unique_ptr<QSAppMigrator> migrator_;
  std::vector<std::string> immutable_;
  std::vector<std::string> packageAtInstall_, payloadAtInstall_, containerAtInstall_;
};

TEST_F(BundleStaging, HandsThePackageDirectoryWithExactlyFiveOptions) {
  snapshotPackageAtInstall();
  ASSERT_TRUE(stage());
  const auto calls = platform_->registry.installCalls();
  ASSERT_EQ(calls.size(), 1u);
  EXPECT_EQ(calls[0].call, "installPackage");
  EXPECT_EQ(calls[0].location.path(), packagePath());
  EXPECT_TRUE(calls[0].hadProgressCallback);
  const Dictionary expected{
      {platform::kRegistryInstallTypeKey, Value(uint64_t{6})},
      {platform::kRegistryPackageTypeKey, Value(platform::kRegistryPackageTypeCustomer)},
      {"VerifyForMigrator", Value(true)},
      {"SkipBlacklist", Value(true)},
      {platform::kBundleIdentifierKey, Value(kIdentifier)},
  };
  EXPECT_EQ(Value(calls[0].options), Value(expected));
  ASSERT_TRUE(calls[0].options.at(platform::kRegistryInstallTypeKey).type() == Value::Type::Unsigned);
  // The bundle was moved, not copied, into Payload.
  EXPECT_EQ(payloadAtInstall_, std::vector<std::string>{"Writer.app"});
  EXPECT_EQ(packageAtInstall_, std::vector<std::string>{"Payload"});
  EXPECT_EQ(containerAtInstall_, std::vector<std::string>{"Staging"});
  EXPECT_TRUE(log_->hostLines().empty());
}

TEST_F(BundleStaging, VPNPluginAndStoreMetadataTravelInThePackage) {
  makeBundle(container_ + "/Tunnel.vpnplugin", "com.example.writer.tunnel");
  ASSERT_TRUE(writeFile(container_ + "/Manifest.plist", "m"));
  ASSERT_TRUE(writeFile(container_ + "/VendraMetadata.plist", "v"));
  ASSERT_TRUE(makeDirs(container_ + "/VendraArtwork"));
  ASSERT_TRUE(makeDirs(container_ + "/Documents"));
  snapshotPackageAtInstall();
  ASSERT_TRUE(stage(container_ + "/Tunnel.vpnplugin"));
  EXPECT_EQ(payloadAtInstall_, (std::vector<std::string>{"Tunnel.vpnplugin", "Writer.app"}));
  EXPECT_EQ(packageAtInstall_,
            (std::vector<std::string>{"Manifest.plist", "Payload", "VendraArtwork", "VendraMetadata.plist"}));
  // User data is not the staging's business.
  EXPECT_EQ(containerAtInstall_, (std::vector<std::string>{"Documents", "Staging"}));
}

TEST_F(BundleStaging, MissingBundleStillAttemptsInstallOfWhatThePackageHolds) {
  // An earlier, interrupted attempt already moved the bundle into Payload.
  ASSERT_TRUE(makeDirs(packagePath() + "/Payload"));
  ASSERT_EQ(rename(bundle_.c_str(), (packagePath() + "/Payload/Writer.app").c_str()), 0);
  ASSERT_TRUE(stage());
  EXPECT_EQ(platform_->registry.installCalls().size(), 1u);
  EXPECT_TRUE(platform_->registry.storedRecord(kIdentifier));
}

TEST_F(BundleStaging, EmptyPackageFailsWithTheInstallError) {
  std::filesystem::remove_all(bundle_);
  EXPECT_FALSE(stage());
  const auto lines = log_->hostLines();
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].level, 3);
  EXPECT_EQ(lines[0].function, kStagingFunction);
  EXPECT_EQ(lines[0].category, "Transvaler");
  EXPECT_EQ(lines[0].message.rfind(
                "QSAppMigrator: Failed to install file://" + packagePath() + "/ : Error Domain=" + kFakeErrorDomain, 0),
            0u)
      << lines[0].message;
}

TEST_F(BundleStaging, PayloadThatCannotBeCreatedStopsBeforeAnyMove) {
  makeImmutable(container_);
  EXPECT_FALSE(stage());
  EXPECT_TRUE(platform_->registry.installCalls().empty());
  EXPECT_TRUE(pathExists(bundle_));
  const auto messages = log_->hostMessages();
  ASSERT_EQ(messages.size(), 1u);
  EXPECT_EQ(messages[0].rfind("QSAppMigrator: Failed to create file://" + packagePath() + "/Payload/ : ", 0), 0u)
      << messages[0];
}

TEST_F(BundleStaging, BundleThatCannotBeMovedFailsWithoutInstall) {
  makeImmutable(bundle_);
  EXPECT_FALSE(stage());
  EXPECT_TRUE(platform_->registry.installCalls().empty());
  const auto messages = log_->hostMessages();
  ASSERT_EQ(messages.size(), 1u);
  EXPECT_EQ(messages[0].rfind("QSAppMigrator: Failed to move bundle from file://" + bundle_ + "/ to file://" +
                                  packagePath() + "/Payload/Writer.app/: Error Domain=",
                              0),
            0u)
      << messages[0];
}

TEST_F(BundleStaging, VPNPluginThatCannotBeMovedFailsAfterTheBundleMoved) {
  const std::string plugin = container_ + "/Tunnel.vpnplugin";
  makeBundle(plugin, "com.example.writer.tunnel");
  makeImmutable(plugin);
  EXPECT_FALSE(stage(plugin));
  EXPECT_TRUE(platform_->registry.installCalls().empty());
  EXPECT_TRUE(pathExists(packagePath() + "/Payload/Writer.app"));
  const auto messages = log_->hostMessages();
  ASSERT_EQ(messages.size(), 1u);
  EXPECT_EQ(messages[0].rfind("QSAppMigrator: Failed to move vpn bundle from file://" + plugin + "/ to file://" +
                                  packagePath() + "/Payload/Tunnel.vpnplugin/: Error Domain=",
                              0),
            0u)
      << messages[0];
}

TEST_F(BundleStaging, ExistingPayloadIsReused) {
  ASSERT_TRUE(makeDirs(packagePath() + "/Payload"));
  EXPECT_TRUE(stage());
}

TEST_F(BundleStaging, AlreadyInstalledRefusalIsSuccessAndReportedFromTheRegistryThread) {
  platform_->registry.alreadyInstalledOf.insert(kIdentifier);
  EXPECT_TRUE(stage());
  EXPECT_EQ(log_->hostMessages(),
            std::vector<std::string>{"QSAppMigrator: Installation of " + bundle_ +
                                     " failed because it's older than what's built into the system. Data migration "
                                     "already happened so we're done here."});
  EXPECT_EQ(log_->hostLines()[0].level, 5);
  ASSERT_FALSE(scripted_->deliveringThreads.empty());
  for (std::thread::id id : scripted_->deliveringThreads) EXPECT_NE(id, std::this_thread::get_id());
}

TEST_F(BundleStaging, AlreadyInstalledFlagSurvivesALaterErrorReport) {
  scripted_->reportsBeforeInstall = {errorReport("ApplicationAlreadyInstalled", "older", "built in")};
  platform_->registry.refuseInstallOf.insert(kIdentifier);
  EXPECT_TRUE(stage());
  const auto messages = log_->hostMessages();
  ASSERT_EQ(messages.size(), 2u);
  EXPECT_EQ(log_->hostLines()[1].level, 3);
  EXPECT_EQ(messages[1], "QSAppMigrator: Installation of " + bundle_ +
                             " failed with Quillset error refused by the test (InstallFailed : (null))");
  EXPECT_FALSE(log_->contains("Failed to install"));
}

TEST_F(BundleStaging, OtherErrorThenFailureLogsBothLines) {
  scripted_->reportsBeforeInstall = {errorReport("PackageCorrupt", "bad package", "no Info.plist")};
  platform_->registry.refuseInstallOf.insert(kIdentifier);
  EXPECT_FALSE(stage());
  const auto messages = log_->hostMessages();
  ASSERT_EQ(messages.size(), 3u);
  EXPECT_EQ(messages[0], "QSAppMigrator: Installation of " + bundle_ +
                             " failed with Quillset error bad package (PackageCorrupt : no Info.plist)");
  EXPECT_EQ(messages[2].rfind("QSAppMigrator: Failed to install file://" + packagePath() + "/ : ", 0), 0u);
}

TEST_F(BundleStaging, ErrorReportWithSuccessfulInstallIsSuccess) {
  scripted_->reportsBeforeInstall = {errorReport("Warning", "transient", "retried")};
  EXPECT_TRUE(stage());
  EXPECT_EQ(log_->hostMessages(),
            std::vector<std::string>{"QSAppMigrator: Installation of " + bundle_ +
                                     " failed with Quillset error transient (Warning : retried)"});
}

TEST_F(BundleStaging, OrdinaryProgressIsNotLogged) {
  scripted_->reportsBeforeInstall = {Dictionary{{platform::kRegistryProgressPercentKey, Value(10)}}};
  EXPECT_TRUE(stage());
  EXPECT_TRUE(log_->hostLines().empty());
}

}  // namespace
}  // namespace qstest
