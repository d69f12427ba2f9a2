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

std::optional<QSContainerInfo> QSAppMigrator::_readContainerInfo(const Dictionary& info) {
  // Nothing of a container whose information lacks a required string is
  // touched.
  for (const char* key : {kQSContainerPathKey, kQSBundlePathKey, kQSBundleIdentifierKey, kQSContainerTypeKey}) {
    if (!QSStringForKey(info, key)) {
      QSAM_LOG(kQSLogLevelError, kFunction, "QSAppMigrator: Container information has no string for %s : %@", key,
               info);
      return std::nullopt;
    }
  }
  QSContainerInfo result{
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

QSContainerSteps QSAppMigrator::_decideContainerSteps(const QSContainerInfo& in) {
  QSContainerSteps steps;
  // Asked before anything changes: the bundle may be moved away later.
  steps.bundleIsPlaceholder = QSFileManager::defaultManager().bundleAtURLIsPlaceholder(in.bundle);
  steps.needsPlaceholder = in.type == kQSContainerTypeApp && !services_.registry->isInstalled(in.identifier);
  return steps;
}

bool QSAppMigrator::_migrateContainerWithInfo(const Dictionary& info) {
  const std::optional<QSContainerInfo> in = _readContainerInfo(info);
  if (!in) return false;
  const QSContainerSteps steps = _decideContainerSteps(*in);
  _writeContainerMarker(info, *in);
  if (!_ensureRecordForContainer(*in, steps)) return false;

  const std::optional<URL> dataContainer = _dataContainerForIdentifier(in->identifier);
  if (!dataContainer) return false;
  QSAM_LOG(kQSLogLevelNotice, kFunction, "QSAppMigrator: Moving data from container %@ to %@", in->container.path(),
           dataContainer->path());
  platform::PlanSize data;
  if (services_.observer) {
    const std::optional<platform::PlanSize> measured = _takeMeasured(in->container);
    data = measured ? *measured : _measureUserData(in->container);
  }
  if (!_migrateDataContainerForIdentifier(in->identifier, in->container, *dataContainer)) return false;
  if (services_.observer) services_.observer->itemsMoved(data.files, data.bytes);

  // The old bundle of a placeholder is only a placeholder: nothing to install.
  const InstallOutcome outcome = steps.installsBundle() ? _installBundleAndGroups(*in) : InstallOutcome::Installed;
  if (outcome == InstallOutcome::KeepContainer) return false;
  // After a failed installation the data has already moved, so the old
  // container goes all the same.
  _removeOldContainer(*in);
  return outcome == InstallOutcome::Installed;
}

// The marker's data is flushed before it gets its name; the name itself needs
// no flush. Every later change of the container (items leaving it, the bundle
// staged, the container removed) is made on the container's own file system
// and cannot reach the disk before the marker's name. Nothing elsewhere
// depends on the marker: an item copied to another file system keeps its
// source in this container until the source is set aside here.
void QSAppMigrator::_writeContainerMarker(const Dictionary& info, const QSContainerInfo& in) {
  if (!platform::plist::writeFile(platform::Value(info), in.container.appending(kQSMigrationMarkerFileName),
                                  platform::plist::Format::XML, true, nullptr,
                                  platform::plist::Durability::DataFlushed)) {
    QSAM_LOG(kQSLogLevelError, kFunction,
             "QSAppMigrator: Failed to write out container marker dictionary... hopefully we don't need it to "
             "recover.");
  }
}

bool QSAppMigrator::_ensureRecordForContainer(const QSContainerInfo& in, const QSContainerSteps& steps) {
  if (in.type != kQSContainerTypeApp) return true;  // a VPN plug-in's record comes with its application
  if (!steps.needsPlaceholder) {
    QSAM_LOG(kQSLogLevelNotice, kFunction, "QSAppMigrator: App %@ is already installed, so not creating placeholder.",
             in.identifier);
    return true;
  }
  return _stageAndInstallPlaceholderForBundleAtURL(in.bundle, in.identifier, in.container);
}

std::optional<URL> QSAppMigrator::_dataContainerForIdentifier(const std::string& identifier) {
  const std::optional<platform::BundleRecord> record = services_.registry->recordForIdentifier(identifier);
  if (!record) {
    QSAM_LOG(kQSLogLevelError, kFunction, "QSAppMigrator: Failed to get bundle proxy for identifier %@", identifier);
    return std::nullopt;
  }
  if (!record->dataContainerURL) {
    logRecordWithoutDataContainer(*record, identifier);
    return std::nullopt;
  }
  return record->dataContainerURL;
}

QSAppMigrator::InstallOutcome QSAppMigrator::_installBundleAndGroups(const QSContainerInfo& in) {
  QSAM_LOG(kQSLogLevelNotice, kFunction, "QSAppMigrator: Staging and installing app %@ at %@ (and secondary %@)",
           in.identifier, in.bundle.path(),
           in.secondBundle ? std::optional<std::string>(in.secondBundle->path()) : std::nullopt);
  if (!_stageAndInstallBundleAtURL(in.bundle, in.identifier, in.secondBundle, in.container)) {
    return InstallOutcome::FailedAfterDataMoved;
  }
  const auto groupSizes = services_.observer ? _measureGroupsForIdentifier(in.identifier)
                                             : std::map<std::string, platform::PlanSize>{};
  const bool groupsMigrated = _migrateGroupContainersForIdentifier(in.identifier);
  // A group whose map entry is gone has had its items moved.
  for (const auto& [group, size] : groupSizes) {
    if (!_groupContainerMap || !QSValueForKey(*_groupContainerMap, group)) {
      services_.observer->itemsMoved(size.files, size.bytes);
    }
  }
  if (!groupsMigrated) return InstallOutcome::KeepContainer;
  if (_containerHasMissedItems(in.container, in.identifier)) return InstallOutcome::KeepContainer;
  return InstallOutcome::Installed;
}

void QSAppMigrator::_removeOldContainer(const QSContainerInfo& in) {
  QSAM_LOG(kQSLogLevelNotice, kFunction, "QSAppMigrator: Removing container for %@ at %@", in.identifier,
           in.container.path());
  Error error;
  if (!QSFileManager::defaultManager().removeItemAtURL(in.container, &error)) {
    QSAM_LOG(kQSLogLevelError, kFunction, "QSAppMigrator: Failed to remove container %@ : %@", in.container.path(),
             error);
  }
}
