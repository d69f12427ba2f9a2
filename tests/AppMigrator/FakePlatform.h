// Fakes of the platform services the migrator uses, and a fixture that builds
// old layouts for it.
//
// FakeApplicationRegistry keeps its records in memory but lays out real
// directories (bundle, data and group containers) under a directory of the
// test's, so that what the migrator moves can be checked on disk. Each fake
// has knobs that make individual calls fail, and records the calls it saw.
//
// Thread safety: the registry fake delivers installation progress on a thread
// of its own, as the real registry does, and joins it before returning; its
// state is guarded by its own lock. The other fakes are used from the test's
// thread only, except where a member says otherwise.
#pragma once

#include <atomic>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "AppMigrator/QSAppMigrator.h"
#include "Platform/BundleReader.h"
#include "Platform/Foundation/Error.h"
#include "Platform/Foundation/URL.h"
#include "Platform/Foundation/Value.h"
#include "Platform/Imaging.h"
#include "Platform/Registry/ApplicationRegistry.h"
#include "Platform/Registry/InstallationDaemon.h"
#include "Platform/SystemVersion.h"
#include "support/TestSupport.h"

namespace qstest {

// The domain of the errors the fakes make up.
inline constexpr char kFakeErrorDomain[] = "FakePlatformErrorDomain";

class FakeApplicationRegistry final : public platform::ApplicationRegistry {
 public:
  // Containers are made under `containersRoot`: Bundle/<id>/, Data/<id>/,
  // Shared/<group>/.
  explicit FakeApplicationRegistry(std::string containersRoot);

  // Records an installed application (bundle type "User") with a data
  // container made on disk, unless `withDataContainer` is false. Returns a
  // copy of the record.
  platform::BundleRecord addInstalledApplication(const std::string& identifier, bool withDataContainer = true);
  // Replaces (or adds) a record as given.
  void setRecord(const platform::BundleRecord& record);
  // The record as stored, whatever the knobs say.
  std::optional<platform::BundleRecord> storedRecord(const std::string& identifier) const;
  std::string dataContainerPath(const std::string& identifier) const;

  // --- Knobs (set before the code under test runs) ---------------------------
  std::set<std::string> refuseInstallOf;       // installPackage/installBundle fail with an error
  std::set<std::string> alreadyInstalledOf;    // installPackage reports "ApplicationAlreadyInstalled"
  std::set<std::string> hideRecordOf;          // recordForIdentifier yields none
  // Called at the start of every call with the call's name ("isInstalled",
  // "recordForIdentifier", "installPackage", "installBundle") and the
  // identifier; on the caller's thread.
  std::function<void(const std::string& call, const std::string& identifier)> observer;

  // --- What was seen -----------------------------------------------------------
  struct InstallCall {
    std::string call;  // "installPackage" or "installBundle"
    platform::URL location;
    platform::Dictionary options;
    bool hadProgressCallback = false;
  };
  std::vector<InstallCall> installCalls() const;
  std::vector<std::string> isInstalledQueries() const;

  bool isInstalled(const std::string& identifier) override;
  std::optional<platform::BundleRecord> recordForIdentifier(const std::string& identifier) override;
  bool installPackage(const platform::URL& package, const platform::Dictionary& options,
                      const platform::InstallProgressCallback& progress, platform::Error* error) override;
  bool installBundle(const platform::URL& bundle, const platform::Dictionary& options,
                     platform::Error* error) override;

 private:
  void notify(const std::string& call, const std::string& identifier);
  // Moves `bundle` into the identifier's bundle container and makes its data
  // container. Requires mutex_.
  bool placeBundleLocked(const platform::URL& bundle, const std::string& identifier, const std::string& bundleType,
                         bool isPlaceholder, platform::Error* error);

  const std::string root_;
  mutable std::mutex mutex_;  // guards everything below
  std::map<std::string, platform::BundleRecord> records_;
  std::vector<InstallCall> installCalls_;
  std::vector<std::string> isInstalledQueries_;
};

class FakeInstallationDaemon final : public platform::InstallationDaemonClient {
 public:
  struct SafeHarborCall {
    std::string path;
    std::string identifier;
    int containerType = 0;
    bool optionsWereNull = false;
  };

  // --- Knobs ---------------------------------------------------------------------
  std::set<std::string> refuseSafeHarborOf;  // registration refused for these identifiers
  bool dataProtectionUpdateSucceeds = true;

  // --- What was seen ---------------------------------------------------------------
  std::vector<SafeHarborCall> safeHarborCalls;
  std::vector<platform::Dictionary> dataProtectionCalls;

  bool QuillsetRegisterSafeHarborForContainerType(const std::string& path, const std::string& identifier,
                                                  int containerType, const platform::Value* options) override;
  bool QuillsetUpdateContainerDataProtectionForMigratorOnly(const platform::Dictionary& options) override;
};

class FakeSystemVersionSource final : public platform::SystemVersionSource {
 public:
  // None makes systemVersionDictionary fail.
  std::optional<platform::Dictionary> dictionary;
  std::optional<platform::Dictionary> systemVersionDictionary() override { return dictionary; }
};

// A bundle reader that forwards to the real one, except for bundles it is told
// to fail.
class FaultyBundleReader final : public platform::BundleReader {
 public:
  explicit FaultyBundleReader(platform::BundleReader& inner) : inner_(inner) {}

  // --- Knobs (paths of bundle directories) ---------------------------------------
  std::set<std::string> unopenable;        // openBundle yields null
  std::set<std::string> noInfoDictionary;  // infoDictionary yields none
  std::set<std::string> noFilteredInfo;    // filteredInfoPlist yields none
  // Called at the start of every openBundle with the URL.
  std::function<void(const platform::URL&)> onOpen;

  std::shared_ptr<platform::Bundle> openBundle(const platform::URL& url) override;
  std::optional<platform::Dictionary> infoDictionary(const platform::Bundle& bundle) override;
  std::optional<platform::Value> filteredInfoPlist(const platform::Bundle& bundle,
                                                   const std::set<std::string>& keys) override;

 private:
  platform::BundleReader& inner_;
};

// An icon renderer that draws a plain opaque square, or fails when told to.
class FakeIconRenderer final : public platform::IconRenderer {
 public:
  bool fail = false;
  std::optional<platform::Image> homeScreenIconForBundle(const platform::Bundle& bundle) override;
};

// An image encoding that forwards to the real one, or fails when told to.
class FaultyImageEncoding final : public platform::ImageEncoding {
 public:
  explicit FaultyImageEncoding(platform::ImageEncoding& inner) : inner_(inner) {}
  bool failCreate = false;
  bool failFinalize = false;
  std::unique_ptr<platform::ImageEncoder> createEncoder(platform::Data& buffer, std::string_view typeIdentifier,
                                                        size_t imageCount) override;

 private:
  platform::ImageEncoding& inner_;
};

// Every fake together, wired into QSMigratorServices.
class FakePlatform {
 public:
  // `root` is a directory of the test's: containers go under root/containers,
  // the temporary directory is root/tmp.
  explicit FakePlatform(const std::string& root);
  FakePlatform(const FakePlatform&) = delete;
  FakePlatform& operator=(const FakePlatform&) = delete;

  QSMigratorServices services();

  platform::FileBundleReader realBundleReader;
  platform::PNGImageEncoding realImageEncoding;
  FakeApplicationRegistry registry;
  FakeInstallationDaemon daemon;
  FaultyBundleReader bundleReader;
  FakeIconRenderer iconRenderer;
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

  // The layout, from the shared configuration.
  std::string oldApplicationsPath() const;  // the old applications directory
  std::string oldInstallMapPath() const;
  std::string dataDirectoryPath() const;  // made by the configuration on access

  // A container directory in the old applications directory.
  std::string makeContainer(const std::string& name);
  // A bundle directory at `path` whose Info.plist holds `identifier` (no
  // identifier key when it is empty).
  void makeBundle(const std::string& path, const std::string& identifier);
  // Writes a property list (XML) and fails the test when it cannot.
  void writePlist(const std::string& path, const platform::Value& value);
  std::optional<platform::Dictionary> readPlist(const std::string& path);
  // A container information dictionary.
  static platform::Dictionary containerInfo(const std::string& containerPath, const std::string& bundlePath,
                                            const std::string& identifier, const std::string& type,
                                            const std::string& secondBundlePath = "");

  std::unique_ptr<QSAppMigrator> createMigrator();

  // Host-log lines whose message is exactly `message`.
  std::vector<platform::HostLogLine> hostLines(const std::string& message) const;
  size_t hostLineCount(const std::string& message) const { return hostLines(message).size(); }
  // Messages of the host-log lines that start with `prefix`, in order.
  std::vector<std::string> hostMessagesStartingWith(const std::string& prefix) const;

  std::unique_ptr<TempDir> scratch_;  // fakes' containers and the temporary directory
  std::unique_ptr<FakePlatform> platform_;
  std::unique_ptr<LogCapture> log_;
};

// A fresh directory on /dev/shm (another file system than the test root's),
// removed with everything in it when the object goes away.
class TempDirOnSharedMemory {
 public:
  TempDirOnSharedMemory();
  ~TempDirOnSharedMemory();
  TempDirOnSharedMemory(const TempDirOnSharedMemory&) = delete;
  TempDirOnSharedMemory& operator=(const TempDirOnSharedMemory&) = delete;
  const std::string& path() const { return path_; }

 private:
  std::string path_;
};

bool pathExists(const std::string& path);  // lstat
std::vector<std::string> directoryNames(const std::string& path);  // sorted; empty when unreadable

}  // namespace qstest
