#include "FakePlatform.h"

#include <stdlib.h>
#include <sys/stat.h>

#include <algorithm>
#include <filesystem>
#include <thread>

#include "Platform/Foundation/PropertyList.h"
#include "Shared/Support/QSGlobalConfiguration.h"

namespace fs = std::filesystem;
using platform::Dictionary;
using platform::Error;
using platform::URL;
using platform::Value;

namespace qstest {

namespace {

Error fakeError(const std::string& message) {
  return Error(kFakeErrorDomain, 1, Dictionary{{platform::kLocalizedDescriptionKey, Value(message)}});
}

bool fail(Error* error, const std::string& message) {
  if (error) *error = fakeError(message);
  return false;
}

std::optional<Dictionary> infoPlistOf(const fs::path& bundle) {
  return platform::plist::readDictionary(URL::fileURL((bundle / platform::kInfoPlistFileName).string()));
}

std::string identifierIn(const Dictionary& options) {
  const Value* value = QSValueForKey(options, platform::kBundleIdentifierKey);
  return value && value->isString() ? *value->asString() : std::string();
}

// The first child of `directory` with `extension` (".app"), or an empty path.
fs::path firstChildWithExtension(const fs::path& directory, const std::string& extension) {
  std::vector<fs::path> found;
  std::error_code ec;
  for (const auto& entry : fs::directory_iterator(directory, ec)) {
    if (entry.path().extension() == extension) found.push_back(entry.path());
  }
  std::sort(found.begin(), found.end());
  return found.empty() ? fs::path() : found.front();
}

// Delivers each report on a thread of its own and waits for it, as the real
// registry does.
void deliver(const platform::InstallProgressCallback& progress, const std::vector<Dictionary>& reports) {
  if (!progress) return;
  std::thread worker([&] {
    for (const Dictionary& report : reports) progress(report);
  });
  worker.join();
}

Dictionary statusReport(const char* status, int percent) {
  return Dictionary{{platform::kRegistryProgressStatusKey, Value(status)},
                    {platform::kRegistryProgressPercentKey, Value(percent)}};
}

Dictionary errorReport(const std::string& errorName, const std::string& description) {
  return Dictionary{{platform::kRegistryProgressErrorKey, Value(errorName)},
                    {platform::kRegistryProgressErrorDescriptionKey, Value(description)}};
}

}  // namespace

// --- FakeApplicationRegistry ---------------------------------------------------------

FakeApplicationRegistry::FakeApplicationRegistry(std::string containersRoot) : root_(std::move(containersRoot)) {}

platform::BundleRecord FakeApplicationRegistry::addInstalledApplication(const std::string& identifier,
                                                                        bool withDataContainer) {
  platform::BundleRecord record;
  record.identifier = identifier;
  record.bundleType = platform::kBundleTypeUser;
  const fs::path bundleContainer = fs::path(root_) / "Bundle" / identifier;
  fs::create_directories(bundleContainer / (identifier + ".app"));
  record.bundleContainerURL = URL::fileURL(bundleContainer.string(), true);
  record.bundleURL = URL::fileURL((bundleContainer / (identifier + ".app")).string(), true);
  if (withDataContainer) {
    fs::create_directories(dataContainerPath(identifier));
    record.dataContainerURL = URL::fileURL(dataContainerPath(identifier), true);
  }
  record.groupContainerURLs = std::map<std::string, URL>();
  record.foundBackingBundle = true;
  setRecord(record);
  return record;
}

void FakeApplicationRegistry::setRecord(const platform::BundleRecord& record) {
  std::lock_guard<std::mutex> lock(mutex_);
  records_[record.identifier] = record;
}

std::optional<platform::BundleRecord> FakeApplicationRegistry::storedRecord(const std::string& identifier) const {
  std::lock_guard<std::mutex> lock(mutex_);
  auto it = records_.find(identifier);
  if (it == records_.end()) return std::nullopt;
  return it->second;
}

std::string FakeApplicationRegistry::dataContainerPath(const std::string& identifier) const {
  return (fs::path(root_) / "Data" / identifier).string();
}

std::vector<FakeApplicationRegistry::InstallCall> FakeApplicationRegistry::installCalls() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return installCalls_;
}

std::vector<std::string> FakeApplicationRegistry::isInstalledQueries() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return isInstalledQueries_;
}

void FakeApplicationRegistry::notify(const std::string& call, const std::string& identifier) {
  if (observer) observer(call, identifier);
}

bool FakeApplicationRegistry::isInstalled(const std::string& identifier) {
  notify("isInstalled", identifier);
  std::lock_guard<std::mutex> lock(mutex_);
  isInstalledQueries_.push_back(identifier);
  return records_.count(identifier) != 0;
}

std::optional<platform::BundleRecord> FakeApplicationRegistry::recordForIdentifier(const std::string& identifier) {
  notify("recordForIdentifier", identifier);
  if (hideRecordOf.count(identifier)) return std::nullopt;
  return storedRecord(identifier);
}

bool FakeApplicationRegistry::placeBundleLocked(const URL& bundle, const std::string& identifier,
                                                const std::string& bundleType, bool isPlaceholder, Error* error) {
  const fs::path source(bundle.path());
  const fs::path bundleContainer = fs::path(root_) / "Bundle" / identifier;
  const fs::path destination = bundleContainer / source.filename();
  std::error_code ec;
  fs::remove_all(bundleContainer, ec);
  fs::create_directories(bundleContainer, ec);
  if (ec) return fail(error, "cannot make bundle container " + bundleContainer.string() + ": " + ec.message());
  fs::rename(source, destination, ec);
  if (ec) return fail(error, "cannot move " + source.string() + ": " + ec.message());
  fs::create_directories(dataContainerPath(identifier), ec);
  if (ec) return fail(error, "cannot make data container for " + identifier + ": " + ec.message());

  platform::BundleRecord record;
  record.identifier = identifier;
  record.bundleType = bundleType;
  record.bundleURL = URL::fileURL(destination.string(), true);
  record.bundleContainerURL = URL::fileURL(bundleContainer.string(), true);
  record.dataContainerURL = URL::fileURL(dataContainerPath(identifier), true);
  record.foundBackingBundle = true;
  record.isPlaceholder = isPlaceholder;
  if (!isPlaceholder) record.groupContainerURLs = std::map<std::string, URL>();
  records_[identifier] = record;
  return true;
}

bool FakeApplicationRegistry::installPackage(const URL& package, const Dictionary& options,
                                             const platform::InstallProgressCallback& progress, Error* error) {
  const std::string identifier = identifierIn(options);
  notify("installPackage", identifier);
  std::vector<Dictionary> reports;
  bool installed = false;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    installCalls_.push_back({"installPackage", package, options, static_cast<bool>(progress)});
    const fs::path payload = fs::path(package.path()) / "Payload";
    fs::path mainBundle = firstChildWithExtension(payload, ".app");
    const fs::path vpnPlugin = firstChildWithExtension(payload, ".vpnplugin");
    if (mainBundle.empty()) mainBundle = vpnPlugin;
    std::error_code ec;
    if (identifier.empty()) {
      fail(error, "no bundle identifier in the install options");
    } else if (refuseInstallOf.count(identifier)) {
      reports.push_back(errorReport("InstallFailed", "refused by the test"));
      fail(error, "installation of " + identifier + " refused");
    } else if (alreadyInstalledOf.count(identifier)) {
      reports.push_back(errorReport(platform::kRegistryErrorApplicationAlreadyInstalled, identifier));
      fs::remove_all(package.path(), ec);
      fail(error, identifier + " is already installed");
    } else if (mainBundle.empty()) {
      fail(error, "no bundle in " + payload.string());
    } else {
      // Read the groups before the bundle moves.
      std::optional<Dictionary> info = infoPlistOf(mainBundle);
      const bool mainIsApplication = mainBundle != vpnPlugin;
      installed = placeBundleLocked(URL::fileURL(mainBundle.string(), true), identifier,
                                    mainIsApplication ? platform::kBundleTypeUser : platform::kBundleTypeVPNPlugin,
                                    false, error);
      if (installed && mainIsApplication && !vpnPlugin.empty()) {
        std::optional<Dictionary> pluginInfo = infoPlistOf(vpnPlugin);
        const std::string* pluginIdentifier =
            pluginInfo ? QSStringForKey(*pluginInfo, platform::kBundleIdentifierKey) : nullptr;
        installed = pluginIdentifier ? placeBundleLocked(URL::fileURL(vpnPlugin.string(), true), *pluginIdentifier,
                                                         platform::kBundleTypeVPNPlugin, false, error)
                                     : fail(error, "VPN plug-in without identifier");
      }
      if (installed && info) {
        const Value* groups = QSValueForKey(*info, platform::kApplicationGroupsKey);
        if (groups && groups->isArray()) {
          auto& groupURLs = *records_[identifier].groupContainerURLs;
          for (const Value& group : *groups->asArray()) {
            if (!group.isString()) continue;
            const fs::path groupContainer = fs::path(root_) / "Shared" / *group.asString();
            fs::create_directories(groupContainer, ec);
            groupURLs[*group.asString()] = URL::fileURL(groupContainer.string(), true);
          }
        }
      }
      if (installed) {
        fs::remove_all(package.path(), ec);
        reports.push_back(statusReport("Installing", 50));
        reports.push_back(statusReport("Complete", 100));
      }
    }
  }
  deliver(progress, reports);
  return installed;
}

bool FakeApplicationRegistry::installBundle(const URL& bundle, const Dictionary& options, Error* error) {
  std::string identifier = identifierIn(options);
  if (identifier.empty()) {
    std::optional<Dictionary> info = infoPlistOf(bundle.path());
    const std::string* fromInfo = info ? QSStringForKey(*info, platform::kBundleIdentifierKey) : nullptr;
    if (fromInfo) identifier = *fromInfo;
  }
  notify("installBundle", identifier);
  std::lock_guard<std::mutex> lock(mutex_);
  installCalls_.push_back({"installBundle", bundle, options, false});
  if (identifier.empty()) return fail(error, "no bundle identifier for " + bundle.path());
  if (refuseInstallOf.count(identifier)) return fail(error, "installation of " + identifier + " refused");
  return placeBundleLocked(bundle, identifier, platform::kBundleTypePlaceholder, true, error);
}

// --- FakeInstallationDaemon -----------------------------------------------------------

bool FakeInstallationDaemon::QuillsetRegisterSafeHarborForContainerType(const std::string& path,
                                                                        const std::string& identifier,
                                                                        int containerType, const Value* options) {
  safeHarborCalls.push_back({path, identifier, containerType, options == nullptr});
  return refuseSafeHarborOf.count(identifier) == 0;
}

bool FakeInstallationDaemon::QuillsetUpdateContainerDataProtectionForMigratorOnly(const Dictionary& options) {
  dataProtectionCalls.push_back(options);
  return dataProtectionUpdateSucceeds;
}

// --- FaultyBundleReader ------------------------------------------------------------------

std::shared_ptr<platform::Bundle> FaultyBundleReader::openBundle(const URL& url) {
  if (onOpen) onOpen(url);
  if (unopenable.count(url.path())) return nullptr;
  return inner_.openBundle(url);
}

std::optional<Dictionary> FaultyBundleReader::infoDictionary(const platform::Bundle& bundle) {
  if (noInfoDictionary.count(bundle.url().path())) return std::nullopt;
  return inner_.infoDictionary(bundle);
}

std::optional<Value> FaultyBundleReader::filteredInfoPlist(const platform::Bundle& bundle,
                                                           const std::set<std::string>& keys) {
  if (noFilteredInfo.count(bundle.url().path())) return std::nullopt;
  return inner_.filteredInfoPlist(bundle, keys);
}

// --- Imaging -------------------------------------------------------------------------------

std::optional<platform::Image> FakeIconRenderer::homeScreenIconForBundle(const platform::Bundle&) {
  if (fail) return std::nullopt;
  platform::Image image;
  image.width = platform::kHomeScreenIconSize;
  image.height = platform::kHomeScreenIconSize;
  image.rgba.assign(static_cast<size_t>(image.width) * image.height * 4, 0xff);
  return image;
}

std::unique_ptr<platform::ImageEncoder> FaultyImageEncoding::createEncoder(platform::Data& buffer,
                                                                           std::string_view typeIdentifier,
                                                                           size_t imageCount) {
  if (failCreate) return nullptr;
  std::unique_ptr<platform::ImageEncoder> inner = inner_.createEncoder(buffer, typeIdentifier, imageCount);
  if (!inner || !failFinalize) return inner;
  // Encodes as asked but reports that nothing was written.
  struct FailingFinalize final : platform::ImageEncoder {
    explicit FailingFinalize(std::unique_ptr<platform::ImageEncoder> wrapped) : wrapped_(std::move(wrapped)) {}
    void addImage(const platform::Image& image) override { wrapped_->addImage(image); }
    bool finalize() override { return false; }
    std::unique_ptr<platform::ImageEncoder> wrapped_;
  };
  return std::make_unique<FailingFinalize>(std::move(inner));
}

// --- FakePlatform -----------------------------------------------------------------------------

FakePlatform::FakePlatform(const std::string& root)
    : registry(root + "/containers"),
      bundleReader(realBundleReader),
      imageEncoding(realImageEncoding),
      temporaryDirectory(root + "/tmp") {
  fs::create_directories(temporaryDirectory);
  systemVersion.dictionary = Dictionary{{platform::kSystemVersionBuildVersionKey, Value("21A100")},
                                        {platform::kSystemVersionProductVersionKey, Value("21.0")},
                                        {platform::kSystemVersionProductNameKey, Value("Quillset OS")}};
}

QSMigratorServices FakePlatform::services() {
  QSMigratorServices services;
  services.registry = &registry;
  services.daemon = &daemon;
  services.bundleReader = &bundleReader;
  services.iconRenderer = &iconRenderer;
  services.imageEncoding = &imageEncoding;
  services.systemVersion = &systemVersion;
  services.temporaryDirectory = URL::fileURL(temporaryDirectory, true);
  return services;
}

// --- MigratorTest -------------------------------------------------------------------------------

namespace {
void removeLayout() {
  std::error_code ec;
  fs::remove_all(systemRoot() + "/private", ec);
  ASSERT_FALSE(ec) << "cannot clear the layout: " << ec.message();
}
}  // namespace

void MigratorTest::SetUp() {
  removeLayout();
  scratch_ = std::make_unique<TempDir>("migrator");
  platform_ = std::make_unique<FakePlatform>(scratch_->path());
  log_ = std::make_unique<LogCapture>();
}

void MigratorTest::TearDown() {
  log_.reset();
  platform_.reset();
  scratch_.reset();
  removeLayout();
}

std::string MigratorTest::oldApplicationsPath() const {
  return QSGlobalConfiguration::sharedInstance().oldContainerPath().path();
}

std::string MigratorTest::oldInstallMapPath() const {
  return QSGlobalConfiguration::sharedInstance().oldInstallMapPath().path();
}

std::string MigratorTest::dataDirectoryPath() const {
  return QSGlobalConfiguration::sharedInstance().dataDirectory().path();
}

std::string MigratorTest::makeContainer(const std::string& name) {
  const std::string path = oldApplicationsPath() + "/" + name;
  EXPECT_TRUE(makeDirs(path));
  return path;
}

void MigratorTest::makeBundle(const std::string& path, const std::string& identifier) {
  ASSERT_TRUE(makeDirs(path));
  Dictionary info{{platform::kBundleExecutableKey, Value("main")}};
  if (!identifier.empty()) info[platform::kBundleIdentifierKey] = Value(identifier);
  writePlist(path + "/" + platform::kInfoPlistFileName, Value(info));
}

void MigratorTest::writePlist(const std::string& path, const Value& value) {
  Error error;
  ASSERT_TRUE(makeDirs(fs::path(path).parent_path().string()));
  ASSERT_TRUE(platform::plist::writeFile(value, URL::fileURL(path), platform::plist::Format::XML, true, &error))
      << error.description();
}

std::optional<Dictionary> MigratorTest::readPlist(const std::string& path) {
  return platform::plist::readDictionary(URL::fileURL(path));
}

Dictionary MigratorTest::containerInfo(const std::string& containerPath, const std::string& bundlePath,
                                       const std::string& identifier, const std::string& type,
                                       const std::string& secondBundlePath) {
  Dictionary info{{kQSContainerPathKey, Value(containerPath)},
                  {kQSBundlePathKey, Value(bundlePath)},
                  {kQSBundleIdentifierKey, Value(identifier)},
                  {kQSContainerTypeKey, Value(type)}};
  if (!secondBundlePath.empty()) info[kQSSecondBundlePathKey] = Value(secondBundlePath);
  return info;
}

std::unique_ptr<QSAppMigrator> MigratorTest::createMigrator() { return QSAppMigrator::create(platform_->services()); }

std::vector<platform::HostLogLine> MigratorTest::hostLines(const std::string& message) const {
  std::vector<platform::HostLogLine> found;
  for (const auto& line : log_->hostLines()) {
    if (line.message == message) found.push_back(line);
  }
  return found;
}

std::vector<std::string> MigratorTest::hostMessagesStartingWith(const std::string& prefix) const {
  std::vector<std::string> found;
  for (const std::string& message : log_->hostMessages()) {
    if (message.rfind(prefix, 0) == 0) found.push_back(message);
  }
  return found;
}

TempDirOnSharedMemory::TempDirOnSharedMemory() {
  std::string pattern = "/dev/shm/qs-migrator.XXXXXX";
  if (!mkdtemp(pattern.data())) {
    ADD_FAILURE() << "mkdtemp on /dev/shm failed";
    return;
  }
  path_ = pattern;
}

TempDirOnSharedMemory::~TempDirOnSharedMemory() {
  if (path_.empty()) return;
  std::error_code ec;
  fs::remove_all(path_, ec);
  EXPECT_FALSE(ec) << "cannot remove " << path_ << ": " << ec.message();
}

bool pathExists(const std::string& path) {
  struct stat status {};
  return lstat(path.c_str(), &status) == 0;
}

std::vector<std::string> directoryNames(const std::string& path) {
  std::vector<std::string> names;
  std::error_code ec;
  for (const auto& entry : fs::directory_iterator(path, ec)) names.push_back(entry.path().filename().string());
  std::sort(names.begin(), names.end());
  return names;
}

}  // namespace qstest
