// Introspection of one old container: what it holds (an application bundle, a
// VPN plug-in bundle, or the marker of an earlier attempt) and so how it is to
// be migrated. Stray files and containers without a bundle are cleaned away.
#include <cerrno>

#include "AppMigrator/QSAppMigrator.h"
#include "Platform/Foundation/PropertyList.h"
#include "Platform/Host/HostLog.h"
#include "Shared/FileManager/QSFileManager.h"
#include "Shared/Support/QSGlobalConfiguration.h"
#include "Shared/Support/QSError.h"
#include "Shared/Support/QSLog.h"

using platform::Dictionary;
using platform::Error;
using platform::URL;
using platform::Value;

namespace {

constexpr char kIntrospectFunction[] = "-[QSAppMigrator _introspectContainer:orderResultEarly:]";
constexpr char kLoadMarkerFunction[] = "-[QSAppMigrator _loadAndValidateMigrationMarkerAtURL:]";

// The children introspection acts on: bundles by exact (case-sensitive) path
// extension, the marker by its whole name. Each is announced with its found
// line and refused as a symbolic link with its link line; the application's
// link check comes before its found line, the others' after.
enum class ChildKind { Application, VPNPlugin, Marker };
struct ChildRule {
  ChildKind kind;
  const char* foundLine;
  const char* linkLine;
  bool announcedBeforeLinkCheck;
  const char* unsafeReason;
};
constexpr ChildRule kChildRules[] = {
    {ChildKind::Application, "QSAppMigrator: Found app %@", "QSAppMigrator: Skipping container with app symlink at %@",
     false, "its application bundle is a symbolic link"},
    {ChildKind::VPNPlugin, "QSAppMigrator: Found vpn plugin %@",
     "QSAppMigrator: VPN plugin was symlink; skipping container %@", true, "its VPN plug-in bundle is a symbolic link"},
    {ChildKind::Marker, "QSAppMigrator: Found migration marker %@",
     "QSAppMigrator: Migration marker was symlink; skipping container %@", true,
     "its migration marker is a symbolic link"},
};
using platform::kApplicationBundleExtension;
using platform::kVPNPluginBundleExtension;

const ChildRule* ruleForChild(const URL& child) {
  const std::string extension = child.pathExtension();
  const ChildKind* kind = nullptr;
  static constexpr ChildKind kApplication = ChildKind::Application, kVPN = ChildKind::VPNPlugin,
                             kMarker = ChildKind::Marker;
  if (extension == kApplicationBundleExtension) {
    kind = &kApplication;
  } else if (extension == kVPNPluginBundleExtension) {
    kind = &kVPN;
  } else if (child.lastPathComponent() == kQSMigrationMarkerFileName) {
    kind = &kMarker;
  }
  if (!kind) return nullptr;
  for (const ChildRule& rule : kChildRules) {
    if (rule.kind == *kind) return &rule;
  }
  return nullptr;
}

QSEntrySurvey surveyResult(QSEntrySurvey::Finding finding, std::string reason = {}) {
  QSEntrySurvey survey;
  survey.finding = finding;
  survey.reason = std::move(reason);
  return survey;
}

// The bundles found so far among a container's children.
struct FoundBundles {
  std::optional<URL> application;
  std::optional<URL> vpnPlugin;
};

}  // namespace

std::vector<URL> QSAppMigrator::_recoverableItems(const URL& container, const std::vector<URL>& unreadableBundles) {
  std::vector<URL> items = unreadableBundles;
  for (const std::string& name : QSGlobalConfiguration::sharedInstance().appUserDataItemNames()) {
    items.push_back(container.appending(name, true));
  }
  return items;
}

std::optional<Dictionary> QSAppMigrator::_introspectContainer(const URL& entry, bool* orderResultEarly) {
  return _actOnSurvey(entry, _surveyEntry(entry), orderResultEarly);
}

std::optional<Dictionary> QSAppMigrator::_actOnSurvey(const URL& entry, QSEntrySurvey survey,
                                                      bool* orderResultEarly) {
  const QSFileManager& fileManager = QSFileManager::defaultManager();
  switch (survey.finding) {
    case QSEntrySurvey::Finding::Container:
      *orderResultEarly = survey.orderEarly;
      return std::move(survey.info);
    case QSEntrySurvey::Finding::StrayFile:
      QSAM_LOG(kQSLogLevelError, kIntrospectFunction, "QSAppMigrator: Found regular file at %@ ; removing",
               entry.path());
      (void)fileManager.removeItemAtURL(entry);  // a stray file; its fate does not change the answer
      _reportEntry(platform::EntryOutcome::Removed, "a regular file among the containers");
      return std::nullopt;
    case QSEntrySurvey::Finding::NoBundle:
      QSAM_LOG(kQSLogLevelError, kIntrospectFunction,
               "QSAppMigrator: No app or vpn bundle found in container %@ ; removing it", entry.path());
      // The user's data and any bundle that could not be read are kept for a
      // person; a container whose items could not all be kept stays.
      if (!_moveItemsToRecovery(_recoverableItems(entry, survey.unreadableBundles), entry)) {
        _reportEntry(platform::EntryOutcome::Kept, "its data could not be moved to the recovery directory");
        return std::nullopt;
      }
      (void)fileManager.removeItemAtURL(entry);  // the outcome does not change the answer
      _reportEntry(platform::EntryOutcome::Removed, "no application or VPN plug-in bundle");
      return std::nullopt;
    case QSEntrySurvey::Finding::Vanished:
      _reportEntry(platform::EntryOutcome::Removed, "gone before it was looked into");
      return std::nullopt;
    case QSEntrySurvey::Finding::Unreadable:
    case QSEntrySurvey::Finding::Unsafe:
      _reportEntry(platform::EntryOutcome::Kept, survey.reason);
      return std::nullopt;
  }
  return std::nullopt;
}

QSEntrySurvey QSAppMigrator::_surveyEntry(const URL& entry) {
  using Finding = QSEntrySurvey::Finding;
  const QSFileManager& fileManager = QSFileManager::defaultManager();

  Error listingError;
  std::optional<std::vector<URL>> children = fileManager.urlsForItemsInDirectoryAtURL(entry, false, &listingError);
  if (!children) {
    if (listingError.isPOSIX(ENOTDIR)) return surveyResult(Finding::StrayFile);
    if (listingError.isPOSIX(ENOENT)) {
      QSAM_LOG(kQSLogLevelNotice, kIntrospectFunction,
               "QSAppMigrator: Got ENOENT when introspecting %@ ; ignoring (likely raced with quilld)", entry.path());
      return surveyResult(Finding::Vanished);
    }
    QSAM_LOG(kQSLogLevelError, kIntrospectFunction, "QSAppMigrator: Failed to get URLs in container %@ : %@",
             entry.path(), listingError);
    return surveyResult(Finding::Unreadable, "it cannot be listed: " + listingError.description());
  }

  Dictionary result{{kQSContainerPathKey, Value(entry.path())}};
  QSEntrySurvey survey;
  FoundBundles found;
  for (const URL& child : *children) {
    // A listed child always has a last component, so its extension ("" when
    // it has none) can always be determined.
    bool isLink = false;
    Error statusError;
    if (!fileManager.isSymbolicLinkAtURL(child, &isLink, &statusError)) {
      const char* text = QSErrorText(static_cast<int>(statusError.code()));
      QSAM_LOG(kQSLogLevelError, kIntrospectFunction, "QSAppMigrator: Failed to stat path %s : %s", child.path(),
               text);
      return surveyResult(Finding::Unreadable, "the status of " + child.path() + " cannot be read: " + text);
    }
    const ChildRule* rule = ruleForChild(child);
    if (!rule) continue;
    if (rule->announcedBeforeLinkCheck) QSAM_LOG(kQSLogLevelNotice, kIntrospectFunction, rule->foundLine, child.path());
    if (isLink) {
      QSAM_LOG(kQSLogLevelError, kIntrospectFunction, rule->linkLine, child.path());
      return surveyResult(Finding::Unsafe, rule->unsafeReason);
    }
    if (!rule->announcedBeforeLinkCheck) QSAM_LOG(kQSLogLevelNotice, kIntrospectFunction, rule->foundLine, child.path());

    if (rule->kind == ChildKind::Marker) {
      std::optional<Dictionary> marker = _loadAndValidateMigrationMarkerAtURL(child);
      if (marker && _identifierIsBuiltIn(*QSStringForKey(*marker, kQSBundleIdentifierKey))) {
        // Its data would be moved into a built-in application's container.
        QSAM_LOG(kQSLogLevelError, kIntrospectFunction,
                 "QSAppMigrator: Migration marker %@ names the built-in application %@ ; keeping container %@",
                 child.path(), QSValueForKey(*marker, kQSBundleIdentifierKey), entry.path());
        return surveyResult(Finding::Unsafe, "its migration marker names a built-in application");
      }
      if (marker) {
        // What an earlier attempt recorded wins over what the container holds
        // now: the bundle may already have left it.
        survey.finding = Finding::Container;
        survey.orderEarly = *QSStringForKey(*marker, kQSContainerTypeKey) == kQSContainerTypeApp;
        survey.fromMarker = true;
        survey.info = std::move(*marker);
        return survey;
      }
      // An unreadable marker describes nothing; the container is taken for what
      // its children show (a new marker is written before work starts), and
      // without a bundle it is removed like any other.
      QSAM_LOG(kQSLogLevelError, kIntrospectFunction, "QSAppMigrator: Failed to load migration marker file from %@",
               child);
      continue;
    }

    std::optional<std::string> identifier = _bundleIdentifierForBundle(child);
    if (!identifier) {
      survey.unreadableBundles.push_back(child);
      if (rule->kind == ChildKind::Application) {
        QSAM_LOG(kQSLogLevelError, kIntrospectFunction, "QSAppMigrator: Could not get identifier for bundle at %@",
                 child.path());
      }
      continue;
    }
    const bool application = rule->kind == ChildKind::Application;
    (application ? found.application : found.vpnPlugin) = child;
    // An application is always the main bundle; a VPN plug-in only while no
    // application has been found.
    if (application || !found.application) {
      result[kQSBundlePathKey] = Value(child.path());
      result[kQSContainerTypeKey] = Value(application ? kQSContainerTypeApp : kQSContainerTypeVPNBundle);
      result[kQSBundleIdentifierKey] = Value(std::move(*identifier));
      survey.orderEarly = application;
    }
  }

  if (!found.application && !found.vpnPlugin) {
    QSEntrySurvey none = surveyResult(Finding::NoBundle);
    none.unreadableBundles = std::move(survey.unreadableBundles);
    return none;
  }
  if (found.application && found.vpnPlugin) result[kQSSecondBundlePathKey] = Value(found.vpnPlugin->path());
  survey.finding = Finding::Container;
  survey.info = std::move(result);
  return survey;
}

std::optional<Dictionary> QSAppMigrator::_loadAndValidateMigrationMarkerAtURL(const URL& marker) {
  std::optional<Dictionary> loaded = platform::plist::readDictionary(
      marker, platform::plist::ReadOptions{.finalLink = platform::plist::FinalLink::Refuse});
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
  if (!_migrationMarkerPathsStayInContainer(*loaded, marker)) return std::nullopt;
  return loaded;
}

std::optional<std::string> QSAppMigrator::_bundleIdentifierForBundle(const URL& bundleURL) {
  std::shared_ptr<platform::Bundle> bundle = services_.bundleReader->openBundle(bundleURL);
  if (!bundle) return std::nullopt;
  return bundle->identifier();
}
