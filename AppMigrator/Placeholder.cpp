// Placeholder installation: a bundle holding only a trimmed Info.plist and the
// home-screen icon, built under the temporary directory and installed through
// the registry before the real bundle is staged.
#include <memory>

#include "AppMigrator/QSAppMigrator.h"
#include "Platform/Foundation/PropertyList.h"
#include "Platform/Host/HostLog.h"
#include "Shared/FileManager/QSFileManager.h"
#include "Shared/Support/QSLog.h"

using platform::Data;
using platform::Dictionary;
using platform::Error;
using platform::URL;
using platform::Value;

namespace {

constexpr char kPlaceholderFunction[] =
    "-[QSAppMigrator _stageAndInstallPlaceholderForBundleAtURL:withIdentifier:inContainerURL:]";
constexpr char kIconFunction[] = "-[QSAppMigrator _writeIconForBundle:toURL:]";
constexpr char kStagedPlaceholdersDirectoryName[] = "com.vantrel.quill.set.migrator";
using platform::kStoreMetadataFileName;
constexpr const char* kBundleExtension = platform::kApplicationBundleExtension;
constexpr size_t kSingleImage = 1;
// The staged bundle's files are written whole (atomically) but not flushed:
// the registry copies them and makes its copy durable with its record, and the
// staged directory is removed when the call ends. After a crash the staged
// directory is reused and its files replaced, so nothing depends on them
// surviving one.
constexpr platform::plist::Durability kStagedFileDurability = platform::plist::Durability::Scratch;

// The keys a placeholder carries over from the application's info dictionary,
// in the order they are copied.
constexpr const char* kPlaceholderInfoKeys[] = {
    platform::kBundleIdentifierKey, platform::kBundleDisplayNameKey,        platform::kBundleExecutableKey,
    platform::kBundleVersionKey,    platform::kBundleShortVersionStringKey,
};

platform::plist::OrderedEntries placeholderInfo(const Dictionary& appInfo) {
  platform::plist::OrderedEntries info;
  info.reserve(std::size(kPlaceholderInfoKeys) + 1);
  for (const char* key : kPlaceholderInfoKeys) {
    const auto found = appInfo.find(key);
    if (found != appInfo.end()) info.emplace_back(key, found->second);
  }
  return info;
}

Dictionary placeholderInstallOptions(const std::string& identifier, const std::optional<Data>& storeMetadata) {
  Dictionary options{
      {platform::kRegistryInstallTypeKey, Value(kQSMigratorInstallType)},
      {platform::kRegistryPackageTypeKey, Value(platform::kRegistryPackageTypePlaceholder)},
      {platform::kBundleIdentifierKey, Value(identifier)},
      {kQSInstallOptionSkipBlacklist, Value(true)},
  };
  if (storeMetadata) options.emplace(platform::kRegistryStoreMetadataKey, Value(*storeMetadata));
  return options;
}

// An identifier names a directory of its own under the staging directory: it
// must be one non-empty path component.
bool isSafeDirectoryName(const std::string& identifier) {
  return !identifier.empty() && identifier.find('/') == std::string::npos;
}

// The store metadata's bytes; none (silently when the file is missing) when
// they cannot be read.
std::optional<Data> readStoreMetadata(const URL& file) {
  Error error;
  std::optional<Data> bytes = platform::plist::readFileBytes(file, &error);
  if (!bytes && !error.is(platform::kFileErrorDomain, platform::kFileReadNoSuchFileError)) {
    QSAM_LOG(kQSLogLevelError, kPlaceholderFunction, "QSAppMigrator: Failed to read %@ : %@", file.path(), error);
  }
  return bytes;
}

}  // namespace

bool QSAppMigrator::_stageAndInstallPlaceholderForBundleAtURL(const URL& bundle, const std::string& withIdentifier,
                                                              const URL& inContainerURL) {
  const QSFileManager& fm = QSFileManager::defaultManager();
  if (!isSafeDirectoryName(withIdentifier)) {
    QSAM_LOG(kQSLogLevelError, kPlaceholderFunction,
             "QSAppMigrator: Refusing to stage a placeholder for identifier \"%@\" (not a single path component)",
             withIdentifier);
    return false;
  }
  const URL storeMetadataURL = inContainerURL.appending(kStoreMetadataFileName);
  const URL staged = services_.temporaryDirectory.appending(kStagedPlaceholdersDirectoryName)
                         .appending(withIdentifier)
                         .appendingPathExtension(kBundleExtension);
  const bool result = _installPlaceholderStagedAtURL(staged, bundle, withIdentifier, storeMetadataURL);
  // Nothing of the staged bundle outlives the call, whatever happened.
  (void)fm.removeItemAtURL(staged);
  return result;
}

bool QSAppMigrator::_installPlaceholderStagedAtURL(const URL& staged, const URL& bundle, const std::string& identifier,
                                                   const URL& storeMetadataURL) {
  Error error;
  if (!QSFileManager::defaultManager().createDirectoryAtURL(staged, true, kQSNewDirectoryMode, &error)) {
    QSAM_LOG(kQSLogLevelError, kPlaceholderFunction,
             "QSAppMigrator: Failed to create staged placeholder directory at %@ : %@", staged.path(), error);
    return false;
  }
  const std::optional<Data> storeMetadata = readStoreMetadata(storeMetadataURL);

  const std::shared_ptr<platform::Bundle> appBundle = services_.bundleReader->openBundle(bundle);
  if (!appBundle) {
    QSAM_LOG(kQSLogLevelError, kPlaceholderFunction, "QSAppMigrator: Failed to create RkBundle for %@", bundle.path());
    return false;
  }
  const std::optional<Dictionary> appInfo = services_.bundleReader->infoDictionary(*appBundle);
  if (!appInfo) {
    QSAM_LOG(kQSLogLevelError, kPlaceholderFunction,
             "QSAppMigrator: Failed to get bundle info dictionary for bundle %@", bundle.path());
    return false;
  }
  platform::plist::OrderedEntries info = placeholderInfo(*appInfo);

  const URL iconURL = staged.appending(platform::kDefaultIconFileName);
  if (_writeIconForBundle(*appBundle, iconURL)) {
    info.emplace_back(platform::kBundleIconFileKey, Value(platform::kDefaultIconFileName));
  } else {
    QSAM_LOG(kQSLogLevelError, kPlaceholderFunction, "QSAppMigrator: Writing placeholder icon for app %@ to %@ failed",
             identifier, iconURL);
  }

  const URL infoURL = staged.appending(platform::kInfoPlistFileName);
  if (!platform::plist::writeOrderedDictionary(info, infoURL, platform::plist::Format::XML, true, nullptr,
                                               kStagedFileDurability)) {
    QSAM_LOG(kQSLogLevelError, kPlaceholderFunction, "QSAppMigrator: Failed to write placeholder Info.plist to %@",
             infoURL);
    return false;
  }

  QSAM_LOG(kQSLogLevelNotice, kPlaceholderFunction, "QSAppMigrator: Installing placeholder for %@", identifier);
  Error installError;
  if (!services_.registry->installBundle(staged, placeholderInstallOptions(identifier, storeMetadata), &installError)) {
    QSAM_LOG(kQSLogLevelError, kPlaceholderFunction, "QSAppMigrator: Failed to install placeholder for %@: %@",
             identifier, installError.userInfo());
    return false;
  }
  return true;
}

bool QSAppMigrator::_writeIconForBundle(const platform::Bundle& bundle, const URL& toURL) {
  Data buffer;
  const std::optional<platform::Image> icon = services_.iconRenderer->homeScreenIconForBundle(bundle);
  if (!icon) {
    QSAM_LOG(kQSLogLevelError, kIconFunction, "QSAppMigrator: Failed to create icon from bundle %@", bundle);
    return false;
  }
  // The encoder writes into `buffer`, declared before it so that it outlives it.
  std::unique_ptr<platform::ImageEncoder> encoder =
      services_.imageEncoding->createEncoder(buffer, platform::kImageTypePNG, kSingleImage);
  if (!encoder) {
    QSAM_LOG(kQSLogLevelError, kIconFunction,
             "QSAppMigrator: VxImageDestinationCreateWithData returned NULL vxImage from bundle %@", bundle);
    return false;
  }
  encoder->addImage(*icon);
  if (!encoder->finalize()) {
    QSAM_LOG(kQSLogLevelError, kIconFunction,
             "QSAppMigrator: VxImageDestinationFinalize failed for icon from bundle %@", bundle);
    return false;
  }
  Error error;
  if (!platform::plist::writeFileBytes(buffer, toURL, true, &error, kStagedFileDurability)) {
    QSAM_LOG(kQSLogLevelError, kIconFunction, "QSAppMigrator: Failed to write image data to %@ : %@", toURL, error);
    return false;
  }
  return true;
}
