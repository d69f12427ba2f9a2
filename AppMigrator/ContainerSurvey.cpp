// Introspection of one old container: what it holds (an application bundle, a
// VPN plug-in bundle, or the marker of an earlier attempt) and so how it is to
// be migrated. Stray files and containers without a bundle are cleaned away.
#include <cerrno>

#include "AppMigrator/QSAppMigrator.h"
#include "Platform/Foundation/PropertyList.h"
#include "Platform/Host/HostLog.h"
#include "Shared/FileManager/QSFileManager.h"
#include "Shared/Support/QSError.h"
#include "Shared/Support/QSLog.h"

using platform::Dictionary;
using platform::Error;
using platform::URL;
using platform::Value;

namespace {

constexpr char kIntrospectFunction[] = "-[QSAppMigrator _introspectContainer:orderResultEarly:]";
constexpr char kLoadMarkerFunction[] = "-[QSAppMigrator _loadAndValidateMigrationMarkerAtURL:]";

// Bundle kinds, by exact (case-sensitive) path extension.
using platform::kApplicationBundleExtension;
using platform::kVPNPluginBundleExtension;

// The bundles found so far among a container's children.
struct FoundBundles {
  std::optional<URL> application;
  std::optional<URL> vpnPlugin;
};

}  // namespace

std::optional<Dictionary> QSAppMigrator::_introspectContainer(const URL& entry, bool* orderResultEarly) {
  const QSFileManager& fileManager = QSFileManager::defaultManager();
  Dictionary result;

  Error listingError;
  std::optional<std::vector<URL>> children = fileManager.urlsForItemsInDirectoryAtURL(entry, false, &listingError);
  if (!children) {
    if (listingError.isPOSIX(ENOTDIR)) {
      QSAM_LOG(kQSLogLevelError, kIntrospectFunction, "QSAppMigrator: Found regular file at %@ ; removing",
               entry.path());
      (void)fileManager.removeItemAtURL(entry);  // a stray file; its fate does not change the answer
    } else if (listingError.isPOSIX(ENOENT)) {
      QSAM_LOG(kQSLogLevelNotice, kIntrospectFunction,
               "QSAppMigrator: Got ENOENT when introspecting %@ ; ignoring (likely raced with quilld)", entry.path());
    } else {
      QSAM_LOG(kQSLogLevelError, kIntrospectFunction, "QSAppMigrator: Failed to get URLs in container %@ : %@",
               entry.path(), listingError);
    }
    return std::nullopt;
  }
  result[kQSContainerPathKey] = Value(entry.path());

  FoundBundles found;
  for (const URL& child : *children) {
    // A listed child always has a last component, so its extension ("" when
    // it has none) can always be determined.
    const std::string extension = child.pathExtension();

    bool isLink = false;
    Error statusError;
    if (!fileManager.isSymbolicLinkAtURL(child, &isLink, &statusError)) {
      QSAM_LOG(kQSLogLevelError, kIntrospectFunction, "QSAppMigrator: Failed to stat path %s : %s", child.path(),
               QSErrorText(static_cast<int>(statusError.code())));
      return std::nullopt;
    }

    if (extension == kApplicationBundleExtension) {
      if (isLink) {
        QSAM_LOG(kQSLogLevelError, kIntrospectFunction, "QSAppMigrator: Skipping container with app symlink at %@",
                 child.path());
        return std::nullopt;
      }
      QSAM_LOG(kQSLogLevelNotice, kIntrospectFunction, "QSAppMigrator: Found app %@", child.path());
      std::optional<std::string> identifier = _bundleIdentifierForBundle(child);
      if (!identifier) {
        QSAM_LOG(kQSLogLevelError, kIntrospectFunction, "QSAppMigrator: Could not get identifier for bundle at %@",
                 child.path());
        continue;
      }
      found.application = child;
      result[kQSBundlePathKey] = Value(child.path());
      result[kQSContainerTypeKey] = Value(kQSContainerTypeApp);
      result[kQSBundleIdentifierKey] = Value(std::move(*identifier));
      *orderResultEarly = true;
    } else if (extension == kVPNPluginBundleExtension) {
      QSAM_LOG(kQSLogLevelNotice, kIntrospectFunction, "QSAppMigrator: Found vpn plugin %@", child.path());
      if (isLink) {
        QSAM_LOG(kQSLogLevelError, kIntrospectFunction, "QSAppMigrator: VPN plugin was symlink; skipping container %@",
                 child.path());
        return std::nullopt;
      }
      std::optional<std::string> identifier = _bundleIdentifierForBundle(child);
      if (!identifier) continue;
      found.vpnPlugin = child;
      if (!found.application) {
        result[kQSBundlePathKey] = Value(child.path());
        result[kQSContainerTypeKey] = Value(kQSContainerTypeVPNBundle);
        result[kQSBundleIdentifierKey] = Value(std::move(*identifier));
        *orderResultEarly = false;
      }
    } else if (child.lastPathComponent() == kQSMigrationMarkerFileName) {
      QSAM_LOG(kQSLogLevelNotice, kIntrospectFunction, "QSAppMigrator: Found migration marker %@", child.path());
      if (isLink) {
        QSAM_LOG(kQSLogLevelError, kIntrospectFunction,
                 "QSAppMigrator: Migration marker was symlink; skipping container %@", child.path());
        return std::nullopt;
      }
      std::optional<Dictionary> marker = _loadAndValidateMigrationMarkerAtURL(child);
      if (marker) {
        // What an earlier attempt recorded wins over what the container holds
        // now: the bundle may already have left it.
        const std::string* type = QSStringForKey(*marker, kQSContainerTypeKey);
        *orderResultEarly = *type == kQSContainerTypeApp;
        return marker;
      }
      // An unreadable marker describes nothing; the container is taken for what
      // its children show (a new marker is written before work starts), and
      // without a bundle it is removed below like any other.
      QSAM_LOG(kQSLogLevelError, kIntrospectFunction, "QSAppMigrator: Failed to load migration marker file from %@",
               child);
    }
  }

  if (!found.application && !found.vpnPlugin) {
    QSAM_LOG(kQSLogLevelError, kIntrospectFunction,
             "QSAppMigrator: No app or vpn bundle found in container %@ ; removing it", entry.path());
    (void)fileManager.removeItemAtURL(entry);  // the outcome does not change the answer
    return std::nullopt;
  }
  if (found.application && found.vpnPlugin) {
    result[kQSSecondBundlePathKey] = Value(found.vpnPlugin->path());
  }
  return result;
}

std::optional<Dictionary> QSAppMigrator::_loadAndValidateMigrationMarkerAtURL(const URL& marker) {
  std::optional<Dictionary> loaded = platform::plist::readDictionary(marker);
  if (!loaded) {
    QSAM_LOG(kQSLogLevelError, kLoadMarkerFunction, "QSAppMigrator: Failed to load migration marker file from %@",
             marker);
    return std::nullopt;
  }

  // Each required key must hold a string; the first that does not ends the
  // check with its own line.
  struct RequiredString {
    const char* key;
    const char* failureLine;
  };
  static constexpr RequiredString kRequired[] = {
      {kQSBundlePathKey, "QSAppMigrator: Failed to get bundle path from migration marker file %@"},
      {kQSContainerTypeKey, "QSAppMigrator: Failed to get container type from migration marker file %@"},
      {kQSContainerPathKey, "QSAppMigrator: Failed to get container path from migration marker file %@"},
      {kQSBundleIdentifierKey, "QSAppMigrator: Failed to get container bundle ID from migration marker file %@"},
  };
  for (const RequiredString& required : kRequired) {
    if (!QSStringForKey(*loaded, required.key)) {
      QSAM_LOG(kQSLogLevelError, kLoadMarkerFunction, required.failureLine, marker.path());
      return std::nullopt;
    }
  }
  const Value* secondBundlePath = QSValueForKey(*loaded, kQSSecondBundlePathKey);
  if (secondBundlePath && !secondBundlePath->isString()) {
    QSAM_LOG(kQSLogLevelError, kLoadMarkerFunction, "QSAppMigrator: Second bundle path was not a string: %@",
             secondBundlePath);
    return std::nullopt;
  }
  return loaded;
}

std::optional<std::string> QSAppMigrator::_bundleIdentifierForBundle(const URL& bundleURL) {
  std::shared_ptr<platform::Bundle> bundle = services_.bundleReader->openBundle(bundleURL);
  if (!bundle) return std::nullopt;
  return bundle->identifier();
}
