// Staging of an old container's bundle into a package and its installation,
// with the registry's progress reports delivered on a thread of its own.
#include "FakePlatform.h"

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
    makeBundle(plugin_, "com.example.writer.tunnel");
    ASSERT_TRUE(makeMigrator());
  }
  bool stage() {
    log_->clear();
    return migrator_->_stageAndInstallBundleAtURL(URL::fileURL(bundle_, true), kIdentifier, URL::fileURL(plugin_, true),
                                                  URL::fileURL(container_, true));
  }
  std::string packagePath() const { return container_ + "/Staging"; }
  std::string reportLine(const std::string& rest) const { return "QSAppMigrator: Installation of " + bundle_ + rest; }

  std::string container_, bundle_, plugin_;
};

TEST_F(BundleStaging, PayloadOrMoveFailureStopsBeforeTheRegistryIsAsked) {
  const std::pair<std::string, std::string> cases[] = {
      {container_, "QSAppMigrator: Failed to create file://" + packagePath() + "/Payload/ : "},
      {bundle_, "QSAppMigrator: Failed to move bundle from file://" + bundle_ + "/ to file://" + packagePath() +
                    "/Payload/Writer.app/: Error Domain="},
      {plugin_, "QSAppMigrator: Failed to move vpn bundle from file://" + plugin_ + "/ to file://" + packagePath() +
                    "/Payload/Tunnel.vpnplugin/: Error Domain="},
  };
  for (const auto& [immutable, line] : cases) {
    makeImmutable(immutable);
    EXPECT_FALSE(stage());
    ASSERT_TRUE(setImmutable(immutable, false));
    immutable_.pop_back();
    EXPECT_EQ(log_->hostMessages().size(), 1u);
    EXPECT_TRUE(loggedOnce(line, true));
  }
  EXPECT_TRUE(platform_->registry.installCalls.empty());
  EXPECT_EQ(directoryNames(packagePath() + "/Payload"), std::vector<std::string>{"Writer.app"});
}

// What the package holds is checked by the end-to-end suite, whose
// verification fails for any bundle, store file or data item misplaced.
TEST_F(BundleStaging, InstalledWithFiveOptionsAndOnlyTheResultAndAlreadyInstalledDecide) {
  platform_->registry.reportsFirst = {errorReport("Warning", "transient", "retried"),
                                      Dictionary{{platform::kRegistryProgressPercentKey, Value(10)}}};
  EXPECT_TRUE(stage());
  EXPECT_EQ(log_->hostMessages(),
            std::vector<std::string>{reportLine(" failed with Quillset error transient (Warning : retried)")});
  ASSERT_EQ(platform_->registry.installCalls.size(), 1u);
  EXPECT_EQ(platform_->registry.installCalls[0].location.path(), packagePath());
  const Dictionary& options = platform_->registry.installCalls[0].options;
  EXPECT_EQ(Value(options), Value(Dictionary{
                                {platform::kRegistryInstallTypeKey, Value(uint64_t{6})},
                                {platform::kRegistryPackageTypeKey, Value(platform::kRegistryPackageTypeCustomer)},
                                {"VerifyForMigrator", Value(true)},
                                {"SkipBlacklist", Value(true)},
                                {platform::kBundleIdentifierKey, Value(kIdentifier)},
                            }));
  EXPECT_EQ(options.at(platform::kRegistryInstallTypeKey).type(), Value::Type::Unsigned);

  makeBundle(bundle_, kIdentifier);
  platform_->registry.reportsFirst.clear();
  platform_->registry.refuseInstallOf.insert(kIdentifier);
  EXPECT_FALSE(stage());
  EXPECT_TRUE(loggedOnce(
      "QSAppMigrator: Failed to install file://" + packagePath() + "/ : Error Domain=" + kFakeErrorDomain, true));

  // Once the registry says the system has it already, a refusal that follows is success.
  platform_->registry.reportsFirst = {errorReport("ApplicationAlreadyInstalled", "older", "built in")};
  EXPECT_TRUE(stage());
  EXPECT_EQ(log_->hostMessages(),
            (std::vector<std::string>{
                reportLine(" failed because it's older than what's built into the system. Data migration already "
                           "happened so we're done here."),
                reportLine(" failed with Quillset error refused by the test (InstallFailed : (null))")}));
}

}  // namespace
}  // namespace qstest
