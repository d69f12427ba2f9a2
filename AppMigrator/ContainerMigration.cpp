// The per-container migration: marker, placeholder, data move, staged
// installation, group containers, missed-item check and removal of the old
// container, in that order.
#include "AppMigrator/QSAppMigrator.h"
#include "Platform/Foundation/PropertyList.h"
#include "Platform/Host/HostLog.h"
#include "Shared/FileManager/QSFileManager.h"
#include "Shared/Support/QSLog.h"

using platform::Dictionary;
using platform::Error;
using platform::URL;

namespace {

constexpr char kFunction[] = "-[QSAppMigrator _migrateContainerWithInfo:]";

// What the container information says, with its paths as URLs.
struct ContainerInfo {
  URL container;
  URL bundle;
  std::optional<URL> secondBundle;
  std::string identifier;
  std::string type;
};

// None, with a line naming the key, when a required entry is not a string:
// nothing of such a container is touched.
std::optional<ContainerInfo> readContainerInfo(const Dictionary& info) {
  for (const char* key : {kQSContainerPathKey, kQSBundlePathKey, kQSBundleIdentifierKey, kQSContainerTypeKey}) {
    if (!QSStringForKey(info, key)) {
      QSAM_LOG(kQSLogLevelError, kFunction, "QSAppMigrator: Container information has no string for %s : %@", key,
               info);
      return std::nullopt;
    }
  }
  ContainerInfo result{
      .container = URL::fileURL(*QSStringForKey(info, kQSContainerPathKey), true),
      .bundle = URL::fileURL(*QSStringForKey(info, kQSBundlePathKey), true),
      .secondBundle = std::nullopt,
      .identifier = *QSStringForKey(info, kQSBundleIdentifierKey),
      .type = *QSStringForKey(info, kQSContainerTypeKey),
  };
  if (const std::string* second = QSStringForKey(info, kQSSecondBundlePathKey)) {
    result.secondBundle = URL::fileURL(*second, true);
  }
  return result;
}

void logRecordWithoutDataContainer(const platform::BundleRecord& record, const std::string& identifier) {
  QSAM_LOG(kQSLogLevelError, kFunction, "QSAppMigrator: Failed to get data container URL for %@", identifier);
  QSAM_LOG(kQSLogLevelError, kFunction, "QSAppMigrator: Proxy had bundle identifier %@", record.identifier);
  QSAM_LOG(kQSLogLevelError, kFunction, "QSAppMigrator: Proxy had bundle type %@", record.bundleType);
  QSAM_LOG(kQSLogLevelError, kFunction, "QSAppMigrator: Proxy had bundle URL %@", record.bundleURL);
  QSAM_LOG(kQSLogLevelError, kFunction, "QSAppMigrator: Proxy had bundle container URL %@", record.bundleContainerURL);
  QSAM_LOG(kQSLogLevelError, kFunction, "QSAppMigrator: Proxy %s have backing bundle",
           record.foundBackingBundle ? "did" : "did not");
}

}  // namespace

bool QSAppMigrator::_migrateContainerWithInfo(const Dictionary& info) {
  const std::optional<ContainerInfo> in = readContainerInfo(info);
  if (!in) return false;
  const QSFileManager& fm = QSFileManager::defaultManager();

  // Asked before anything changes: the bundle may be moved away below.
  const bool bundleIsPlaceholder = fm.bundleAtURLIsPlaceholder(in->bundle);

  if (!platform::plist::writeFile(platform::Value(info), in->container.appending(kQSMigrationMarkerFileName),
                                  platform::plist::Format::XML, true)) {
    QSAM_LOG(kQSLogLevelError, kFunction,
             "QSAppMigrator: Failed to write out container marker dictionary... hopefully we don't need it to "
             "recover.");
  }

  if (in->type == kQSContainerTypeApp) {
    if (services_.registry->isInstalled(in->identifier)) {
      QSAM_LOG(kQSLogLevelNotice, kFunction, "QSAppMigrator: App %@ is already installed, so not creating placeholder.",
               in->identifier);
    } else if (!_stageAndInstallPlaceholderForBundleAtURL(in->bundle, in->identifier, in->container)) {
      return false;
    }
  }

  const std::optional<platform::BundleRecord> record = services_.registry->recordForIdentifier(in->identifier);
  if (!record) {
    QSAM_LOG(kQSLogLevelError, kFunction, "QSAppMigrator: Failed to get bundle proxy for identifier %@",
             in->identifier);
    return false;
  }
  if (!record->dataContainerURL) {
    logRecordWithoutDataContainer(*record, in->identifier);
    return false;
  }
  QSAM_LOG(kQSLogLevelNotice, kFunction, "QSAppMigrator: Moving data from container %@ to %@", in->container.path(),
           record->dataContainerURL->path());
  if (!_migrateDataContainerForIdentifier(in->identifier, in->container, *record->dataContainerURL)) return false;

  bool result = true;
  if (!bundleIsPlaceholder) {
    QSAM_LOG(kQSLogLevelNotice, kFunction, "QSAppMigrator: Staging and installing app %@ at %@ (and secondary %@)",
             in->identifier, in->bundle.path(),
             in->secondBundle ? std::optional<std::string>(in->secondBundle->path()) : std::nullopt);
    if (!_stageAndInstallBundleAtURL(in->bundle, in->identifier, in->secondBundle, in->container)) {
      // The data has already moved, so the old container is removed all the
      // same.
      result = false;
    } else {
      if (!_migrateGroupContainersForIdentifier(in->identifier)) return false;
      if (_containerHasMissedItems(in->container, in->identifier)) return false;
    }
  }

  QSAM_LOG(kQSLogLevelNotice, kFunction, "QSAppMigrator: Removing container for %@ at %@", in->identifier,
           in->container.path());
  Error error;
  if (!fm.removeItemAtURL(in->container, &error)) {
    QSAM_LOG(kQSLogLevelError, kFunction, "QSAppMigrator: Failed to remove container %@ : %@", in->container.path(),
             error);
  }
  return result;
}
