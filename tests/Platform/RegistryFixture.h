// A fresh system root per test, with helpers that build bundles, packages and
// built-in applications in it, and open the registry on it.
#pragma once

#include <gtest/gtest.h>

#include <filesystem>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "Platform/Registry/SQLiteRegistry.h"
#include "support/TestSupport.h"

namespace qstest {

// What goes into a test bundle's Info.plist.
struct BundleSpec {
  BundleSpec() = default;
  explicit BundleSpec(std::string id) : identifier(std::move(id)) {}
  BundleSpec&& withVersion(std::string v) && { return version = std::move(v), std::move(*this); }
  BundleSpec&& withGroups(std::vector<std::string> g) && { return groups = std::move(g), std::move(*this); }
  BundleSpec&& withDisplayName(std::string n) && { return displayName = std::move(n), std::move(*this); }
  BundleSpec&& withoutDataContainer() && { return noDataContainer = true, std::move(*this); }

  std::string identifier;
  std::string version = "1.0";
  std::vector<std::string> groups;
  bool noDataContainer = false;
  std::string displayName;
};

// Info.plist text in the XML form.
std::string infoPlistXML(const BundleSpec& bundle);

class RegistryTest : public testing::Test {
 protected:
  const std::string& root() const { return root_.path(); }
  std::string at(const std::string& relative) const { return root_ / relative; }

  // Opens the registry of this test's root, failing the test when it cannot.
  std::unique_ptr<platform::SQLiteApplicationRegistry> openRegistry();

  // A bundle directory at `path` with an Info.plist and an executable file.
  void makeBundle(const std::string& path, const BundleSpec& bundle);
  // A package directory "<name>" under the test's "packages" folder:
  // Payload/<appName> for the application (when `app` has an identifier),
  // Payload/<pluginName> for the plug-in (when `plugin` has one), and
  // store-metadata files beside Payload.
  std::string makePackage(const std::string& name, const BundleSpec& app, const BundleSpec& plugin = {},
                          const std::vector<std::string>& metadataFiles = {});
  // A built-in application <root>/Applications/<name>.
  std::string makeBuiltIn(const std::string& name, const BundleSpec& bundle);

  // Installs a package with the migrator's options for `identifier`,
  // collecting the progress reports and the threads they came from.
  bool install(platform::SQLiteApplicationRegistry& registry, const std::string& package, const std::string& identifier,
               platform::Error* error = nullptr);

  // Packs `bundle` (and `plugin`) into a fresh package and installs it for
  // the bundle's identifier, failing the test when the registry refuses it.
  bool installApp(platform::SQLiteApplicationRegistry& registry, const BundleSpec& bundle,
                  const BundleSpec& plugin = {});

  std::vector<platform::Dictionary> reports_;
  std::vector<std::thread::id> reporterThreads_;

  // Paths of the layout.
  std::string bundleContainers() const { return at("private/var/containers/Bundle/Application"); }
  std::string appDataContainers() const { return at("private/var/mobile/Containers/Data/Application"); }
  std::string pluginDataContainers() const { return at("private/var/mobile/Containers/Data/PluginKitPlugin"); }
  std::string groupContainers() const { return at("private/var/mobile/Containers/Shared/AppGroup"); }
  std::string databaseDirectory() const { return at("private/var/db/appregistry"); }

  // Entries of a directory (none when it is missing), sorted.
  static std::vector<std::string> entries(const std::string& directory);
  static bool isDirectory(const std::string& path) { return std::filesystem::is_directory(path); }
  static bool exists(const std::string& path) { return std::filesystem::exists(std::filesystem::symlink_status(path)); }

 private:
  TempDir root_{"registry"};
  int packages_ = 0;
};

// The install options the migrator passes for a staged application.
platform::Dictionary customerOptions(const std::string& identifier);

// The values under `key` ("Status" or "Error") of a list of progress
// reports, in order.
std::vector<std::string> reportValues(const std::vector<platform::Dictionary>& reports, const char* key);
inline std::vector<std::string> statuses(const std::vector<platform::Dictionary>& reports) {
  return reportValues(reports, platform::kRegistryProgressStatusKey);
}
// The last "Error" value, or "".
inline std::string reportedError(const std::vector<platform::Dictionary>& reports) {
  std::vector<std::string> errors = reportValues(reports, platform::kRegistryProgressErrorKey);
  return errors.empty() ? "" : errors.back();
}

}  // namespace qstest
