// Staging of an old container's bundle into a package directory inside the
// container, and its installation through the registry.
#include <atomic>
#include <memory>

#include "AppMigrator/QSAppMigrator.h"
#include "Platform/Host/HostLog.h"
#include "Shared/FileManager/QSFileManager.h"
#include "Shared/Support/QSLog.h"

using platform::Dictionary;
using platform::Error;
using platform::URL;
using platform::Value;

namespace {

constexpr char kFunction[] =
    "-[QSAppMigrator _stageAndInstallBundleAtURL:withIdentifier:andVPNPluginAtURL:inContainerURL:]";
constexpr char kPackageDirectoryName[] = "Staging";
constexpr char kPayloadDirectoryName[] = "Payload";

Dictionary stagedInstallOptions(const std::string& identifier) {
  return Dictionary{
      {platform::kRegistryInstallTypeKey, Value(kQSMigratorInstallType)},
      {platform::kRegistryPackageTypeKey, Value(platform::kRegistryPackageTypeCustomer)},
      {kQSInstallOptionVerifyForMigrator, Value(true)},
      {kQSInstallOptionSkipBlacklist, Value(true)},
      {platform::kBundleIdentifierKey, Value(identifier)},
  };
}

// The registry may call this on a thread of its own. It owns a copy of the
// bundle URL and shares the flag with the installing call, so both stay valid
// for as long as the registry holds the callback.
platform::InstallProgressCallback progressCallback(const URL& bundle,
                                                   const std::shared_ptr<std::atomic<bool>>& alreadyInstalled) {
  return [bundle, alreadyInstalled](const Dictionary& progress) {
    const Value* errorName = QSValueForKey(progress, platform::kRegistryProgressErrorKey);
    if (!errorName) return;
    if (*errorName == Value(platform::kRegistryErrorApplicationAlreadyInstalled)) {
      QSAM_LOG(kQSLogLevelNotice, kFunction,
               "QSAppMigrator: Installation of %@ failed because it's older than what's built into the system. Data "
               "migration already happened so we're done here.",
               bundle.path());
      alreadyInstalled->store(true);
      return;
    }
    QSAM_LOG(kQSLogLevelError, kFunction, "QSAppMigrator: Installation of %@ failed with Quillset error %@ (%@ : %@)",
             bundle.path(), QSValueForKey(progress, platform::kRegistryProgressErrorDescriptionKey), *errorName,
             QSValueForKey(progress, platform::kRegistryProgressErrorDetailKey));
  };
}

}  // namespace

bool QSAppMigrator::_stageAndInstallBundleAtURL(const URL& bundle, const std::string& withIdentifier,
                                                const std::optional<URL>& andVPNPluginAtURL,
                                                const URL& inContainerURL) {
  const QSFileManager& fm = QSFileManager::defaultManager();
  const URL package = inContainerURL.appending(kPackageDirectoryName, true);
  const URL payload = package.appending(kPayloadDirectoryName, true);

  auto alreadyInstalled = std::make_shared<std::atomic<bool>>(false);
  const platform::InstallProgressCallback callback = progressCallback(bundle, alreadyInstalled);

  Error error;
  if (!fm.createDirectoryAtURL(payload, true, kQSNewDirectoryMode, &error)) {
    QSAM_LOG(kQSLogLevelError, kFunction, "QSAppMigrator: Failed to create %@ : %@", payload, error);
    return false;
  }
  const URL bundleDestination = payload.appending(bundle.lastPathComponent(), true);
  if (!fm.moveItemIfExistsAtURL(bundle, bundleDestination, &error)) {
    QSAM_LOG(kQSLogLevelError, kFunction, "QSAppMigrator: Failed to move bundle from %@ to %@: %@", bundle,
             bundleDestination, error);
    return false;
  }
  if (andVPNPluginAtURL) {
    const URL pluginDestination = payload.appending(andVPNPluginAtURL->lastPathComponent(), true);
    if (!fm.moveItemIfExistsAtURL(*andVPNPluginAtURL, pluginDestination, &error)) {
      QSAM_LOG(kQSLogLevelError, kFunction, "QSAppMigrator: Failed to move vpn bundle from %@ to %@: %@",
               *andVPNPluginAtURL, pluginDestination, error);
      return false;
    }
  }
  if (!fm.captureStoreDataFromDirectory(inContainerURL, package, false, false, &error)) {
    QSAM_LOG(kQSLogLevelError, kFunction, "QSAppMigrator: Failed to move app metadata from %@ to %@: %@",
             inContainerURL, package, error);
    return false;
  }

  Error installError;
  if (services_.registry->installPackage(package, stagedInstallOptions(withIdentifier), callback, &installError)) {
    return true;
  }
  // Every progress report has been delivered by now, so the flag is final.
  if (alreadyInstalled->load()) return true;
  QSAM_LOG(kQSLogLevelError, kFunction, "QSAppMigrator: Failed to install %@ : %@", package, installError);
  return false;
}
