// The application registry and installation daemon: what the operating system
// knows of installed bundles, and how bundles are installed.
//
// ApplicationRegistry is an interface so that the migrator's unit tests use
// fakes; SQLiteApplicationRegistry (SQLiteRegistry.h) is the real one.
//
// Thread safety: implementations are safe to call from several threads; an
// installation's progress callback may be called on a thread of the
// registry's, and every report is delivered before the installation call
// returns.
#pragma once

#include <functional>
#include <map>
#include <optional>
#include <string>

#include "Platform/Foundation/Error.h"
#include "Platform/Foundation/URL.h"
#include "Platform/Foundation/Value.h"

namespace platform {

// Install options and progress keys with the roles the migrator needs.
inline constexpr char kRegistryInstallTypeKey[] = "InstallType";
inline constexpr char kRegistryPackageTypeKey[] = "PackageType";
inline constexpr char kRegistryPackageTypeCustomer[] = "Customer";
inline constexpr char kRegistryPackageTypePlaceholder[] = "Placeholder";
inline constexpr char kRegistryStoreMetadataKey[] = "StoreMetadata";
// The store-metadata file beside "Payload" in a package, in an installed
// bundle's container and in an application's old container.
inline constexpr char kStoreMetadataFileName[] = "VendraMetadata.plist";
// Progress-report keys.
inline constexpr char kRegistryProgressErrorKey[] = "Error";
inline constexpr char kRegistryProgressErrorDescriptionKey[] = "ErrorDescription";
inline constexpr char kRegistryProgressErrorDetailKey[] = "ErrorDetail";
inline constexpr char kRegistryProgressPercentKey[] = "PercentComplete";
inline constexpr char kRegistryProgressStatusKey[] = "Status";
// The refusal of an application older than the built-in copy.
inline constexpr char kRegistryErrorApplicationAlreadyInstalled[] = "ApplicationAlreadyInstalled";
// The registry's error domain.
inline constexpr char kRegistryErrorDomain[] = "ApplicationRegistryErrorDomain";

// Bundle types a record can have.
inline constexpr char kBundleTypeUser[] = "User";
inline constexpr char kBundleTypeSystem[] = "System";
inline constexpr char kBundleTypePlaceholder[] = "Placeholder";
inline constexpr char kBundleTypeVPNPlugin[] = "VPNPlugin";

// What the registry knows of one installed bundle.
struct BundleRecord {
  std::string identifier;
  std::string bundleType;
  URL bundleURL;
  URL bundleContainerURL;
  std::optional<URL> dataContainerURL;
  // Group identifier to the group's container; an installed bundle's record
  // always has one (empty without groups), a placeholder's has none.
  std::optional<std::map<std::string, URL>> groupContainerURLs;
  bool foundBackingBundle = false;
  // Beyond what the migrator reads: for inspection tools.
  bool isPlaceholder = false;
  std::string version;
  std::string displayName;
  // Read-only views (RegistryReader): the data container is made on the
  // record's first real lookup and does not exist yet.
  bool dataContainerToBeMade = false;
};

// Called with one progress report (a dictionary) at a time.
using InstallProgressCallback = std::function<void(const Dictionary& progress)>;

class ApplicationRegistry {
 public:
  virtual ~ApplicationRegistry() = default;

  virtual bool isInstalled(const std::string& identifier) = 0;
  virtual std::optional<BundleRecord> recordForIdentifier(const std::string& identifier) = 0;

  // Installs the package directory at `package` ("Payload/*.app", optional
  // "*.vpnplugin", store metadata beside "Payload"). `progress` may be empty.
  // Returns only after the last report has been delivered.
  [[nodiscard]] virtual bool installPackage(const URL& package, const Dictionary& options, const InstallProgressCallback& progress,
                              Error* error) = 0;
  // Installs a placeholder bundle directory; no progress reports.
  [[nodiscard]] virtual bool installBundle(const URL& bundle, const Dictionary& options, Error* error) = 0;
};

// What a dry run asks of a registry beyond lookups: where the containers it
// has not made yet will be made, and whether it would refuse a bundle.
class RegistryForecast {
 public:
  virtual ~RegistryForecast() = default;
  // The directory in which a new data container of an application (or of a
  // VPN plug-in) is made.
  virtual URL newDataContainerDirectory(bool vpnPlugin) = 0;
  // The directory in which a new group container is made.
  virtual URL newGroupContainerDirectory() = 0;
  // The container recorded for `group`, or none when it is not made yet.
  virtual std::optional<URL> groupContainerForGroup(const std::string& group) = 0;
  // True when installing `version` of `identifier` would be refused because
  // a built-in copy has an equal or newer version.
  virtual bool refusesAsNotNewerThanBuiltIn(const std::string& identifier, const std::string& version) = 0;
};

}  // namespace platform
