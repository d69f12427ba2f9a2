// Fakes of the platform services the migrator uses, and a fixture that builds
// old layouts for it.
//
// FakeApplicationRegistry keeps its records in memory but lays out real
// directories (bundle, data and group containers) under a directory of the
// test's, so that what the migrator moves can be checked on disk. Knobs make
// calls fail; the calls are recorded.
//
// Thread safety: the fakes are used from the test's thread. The registry fake
// delivers installation progress on a thread of its own, as the real registry
// does, and joins it before returning; that thread touches none of its state.
#pragma once

#include <unistd.h>

#include <filesystem>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "AppMigrator/QSAppMigrator.h"
#include "Platform/Foundation/PropertyList.h"
#include "Shared/Support/QSGlobalConfiguration.h"
#include "support/TestSupport.h"

namespace qstest {

using platform::Dictionary;
using platform::URL;
using platform::Value;

// The domain of the errors the fakes make up.
inline constexpr char kFakeErrorDomain[] = "FakePlatformErrorDomain";

class FakeApplicationRegistry final : public platform::ApplicationRegistry {
 public:
  // Containers are made under `root`: Bundle/<id>/, Data/<id>/, Shared/<group>/.
  explicit FakeApplicationRegistry(std::string root) : root_(std::move(root)) {}

  // Records an installed application (type "User") with a data container on
  // disk, unless `withDataContainer` is false. Returns the record.
  platform::BundleRecord addInstalledApplication(const std::string& identifier, bool withDataContainer = true);
  std::string dataContainerPath(const std::string& identifier) const { return root_ + "/Data/" + identifier; }

  // The records, as stored whatever the knobs say.
  std::map<std::string, platform::BundleRecord> records;

  // --- Knobs ---------------------------------------------------------------------
  std::set<std::string> refuseInstallOf;  // installation fails (a package reports "InstallFailed" first)
  std::set<std::string> hideRecordOf;     // recordForIdentifier yields none
  std::map<std::string, std::vector<std::string>> groupsOf;  // the groups an installed package gets
  std::vector<platform::Dictionary> reportsFirst;            // delivered before a package's own reports
  // Called first in every call with the call's name ("isInstalled",
  // "recordForIdentifier", "installPackage", "installBundle") and the
  // identifier; on the caller's thread.
  std::function<void(const std::string& call, const std::string& identifier)> observer;

  // --- What was seen -------------------------------------------------------------
  struct InstallCall {
    platform::URL location;
    platform::Dictionary options;
  };
  std::vector<InstallCall> installCalls;
  std::vector<std::string> calls;  // "<call> <identifier>", in order

  bool isInstalled(const std::string& identifier) override;
  std::optional<platform::BundleRecord> recordForIdentifier(const std::string& identifier) override;
  bool installPackage(const platform::URL& package, const platform::Dictionary& options,
                      const platform::InstallProgressCallback& progress, platform::Error* error) override;
  bool installBundle(const platform::URL& bundle, const platform::Dictionary& options, platform::Error* error) override;

 private:
  void note(const std::string& call, const std::string& identifier);
  // Moves `items` into the identifier's bundle container (the first ".app",
  // else the first item, is the bundle), makes its data container and records it.
  bool place(const std::vector<std::string>& items, const std::string& identifier, bool placeholder,
             platform::Error* error);

  const std::string root_;
};

class FakeInstallationDaemon final : public platform::InstallationDaemonClient {
 public:
  std::set<std::string> refuseSafeHarborOf;  // knob
  bool dataProtectionUpdateSucceeds = true;  // knob
  // "<identifier> <path> <container type>", with " options" when options were given.
  std::vector<std::string> safeHarborCalls;
  std::vector<platform::Dictionary> dataProtectionCalls;

  bool QuillsetRegisterSafeHarborForContainerType(const std::string& path, const std::string& identifier,
                                                  int containerType, const platform::Value* options) override {
    safeHarborCalls.push_back(identifier + " " + path + " " + std::to_string(containerType) +
                              (options ? " options" : ""));
    return refuseSafeHarborOf.count(identifier) == 0;
  }
  bool QuillsetUpdateContainerDataProtectionForMigratorOnly(const platform::Dictionary& options) override {
    dataProtectionCalls.push_back(options);
    return dataProtectionUpdateSucceeds;
  }
};

class FakeSystemVersionSource final : public platform::SystemVersionSource {
 public:
  std::optional<platform::Dictionary> dictionary;  // none makes the call fail
  std::optional<platform::Dictionary> systemVersionDictionary() override { return dictionary; }
};

// The real PNG encoding, or a failure to create the encoder or to finalize it.
class FaultyImageEncoding final : public platform::ImageEncoding {
 public:
  bool failCreate = false;
  bool failFinalize = false;
  std::unique_ptr<platform::ImageEncoder> createEncoder(platform::Data& buffer, std::string_view typeIdentifier,
                                                        size_t imageCount) override;

 private:
  platform::PNGImageEncoding inner_;
};

// Every fake together, and the real bundle reader and icon renderer. `root` is a directory of
// the test's: containers go under root/containers, the temporary directory is
// root/tmp.
struct FakePlatform {
  explicit FakePlatform(const std::string& root);
  QSMigratorServices services();

  FakeApplicationRegistry registry;
  FakeInstallationDaemon daemon;
  platform::FileBundleReader bundleReader;
  platform::CairoIconRenderer iconRenderer;
  FaultyImageEncoding imageEncoding;
  FakeSystemVersionSource systemVersion;
  const std::string temporaryDirectory;
};

// A test of the migrator against the shared configuration's layout (under the
// test binary's system root), rebuilt empty for every test.
class MigratorTest : public testing::Test {
 protected:
  void SetUp() override;
  void TearDown() override;

  static std::string oldApplicationsPath() { return QSGlobalConfiguration::sharedInstance().oldContainerPath().path(); }
  static std::string oldInstallMapPath() { return QSGlobalConfiguration::sharedInstance().oldInstallMapPath().path(); }
  // Made by the configuration on access.
  static std::string dataDirectoryPath() { return QSGlobalConfiguration::sharedInstance().dataDirectory().path(); }
  static std::string versionRecordPath() { return dataDirectoryPath() + "/AppMigratorLastSystemVersion.plist"; }
  static std::string harborMapPath() { return dataDirectoryPath() + "/SafeHarbor.plist"; }

  // A container directory in the old applications directory.
  static std::string makeContainer(const std::string& name) {
    EXPECT_TRUE(makeDirs(oldApplicationsPath() + "/" + name));
    return oldApplicationsPath() + "/" + name;
  }
  // A bundle directory at `path` whose Info.plist holds `identifier` (no
  // identifier key when it is empty).
  static void makeBundle(const std::string& path, const std::string& identifier) {
    Dictionary info{{platform::kBundleExecutableKey, Value("main")}};
    if (!identifier.empty()) info[platform::kBundleIdentifierKey] = Value(identifier);
    writePlist(path + "/" + platform::kInfoPlistFileName, Value(info));
  }
  // A container `name` holding the application `identifier`.app.
  static std::string makeBundleContainer(const std::string& name, const std::string& identifier) {
    makeBundle(makeContainer(name) + "/" + identifier + ".app", identifier);
    return oldApplicationsPath() + "/" + name;
  }
  // Writes XML, with the directories it needs; fails the test when it cannot.
  static void writePlist(const std::string& path, const Value& value) {
    ASSERT_TRUE(makeDirs(std::filesystem::path(path).parent_path().string()));
    ASSERT_TRUE(platform::plist::writeFile(value, URL::fileURL(path), platform::plist::Format::XML, true));
  }
  static void writeInstallMap(const Dictionary& map = {}) { writePlist(oldInstallMapPath(), Value(map)); }
  static std::optional<Dictionary> readPlist(const std::string& path) {
    return platform::plist::readDictionary(URL::fileURL(path));
  }
  // Sets the immutable flag on `path`; TearDown clears it.
  void makeImmutable(const std::string& path) {
    ASSERT_TRUE(setImmutable(path, true));
    immutable_.push_back(path);
  }
  static Dictionary containerInfo(const std::string& container, const std::string& bundle,
                                  const std::string& identifier, const std::string& type) {
    return Dictionary{{kQSContainerPathKey, Value(container)},
                      {kQSBundlePathKey, Value(bundle)},
                      {kQSBundleIdentifierKey, Value(identifier)},
                      {kQSContainerTypeKey, Value(type)}};
  }
  std::unique_ptr<QSAppMigrator> createMigrator() { return QSAppMigrator::create(platform_->services()); }
  // Creates migrator_, for the tests that call the run's steps one by one.
  bool makeMigrator() { return (migrator_ = createMigrator()) != nullptr; }

  // Exactly one host-log line is `message` (or, with `prefix`, starts with it).
  testing::AssertionResult loggedOnce(const std::string& message, bool prefix = false) const;

  std::unique_ptr<TempDir> scratch_;  // the fakes' containers and the temporary directory
  std::unique_ptr<FakePlatform> platform_;
  std::unique_ptr<LogCapture> log_;
  std::unique_ptr<QSAppMigrator> migrator_;  // made by makeMigrator()
  std::vector<std::string> immutable_;
};

inline bool pathExists(const std::string& path) {  // a link counts, whatever it points to
  return std::filesystem::exists(std::filesystem::symlink_status(path));
}
std::vector<std::string> directoryNames(const std::string& path);  // sorted; empty when unreadable

}  // namespace qstest
