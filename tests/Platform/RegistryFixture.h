// A fresh system root per test, with helpers that build bundles, packages and
// built-in applications in it, and open the registry on it.
#pragma once

#include <gmock/gmock.h>

#include <filesystem>
#include <functional>

#include "Platform/BundleReader.h"
#include "Platform/Foundation/PropertyList.h"
#include "Platform/Registry/SQLiteRegistry.h"
#include "support/TestSupport.h"

namespace qstest {

// What goes into a test bundle's Info.plist (no identifier key when empty).
struct TestBundle {
  std::string identifier;
  std::string version = "1.0";
  std::vector<std::string> groups = {};
  bool noDataContainer = false;
};

// The install options of a staged application, or of another package type.
inline platform::Dictionary installOptions(const std::string& identifier,
                                           const char* type = platform::kRegistryPackageTypeCustomer) {
  return {{platform::kRegistryPackageTypeKey, type}, {platform::kBundleIdentifierKey, identifier}};
}

// The error's code when it is in the registry's domain, else -1.
inline int64_t registryCode(const platform::Error& e) {
  return e.is(platform::kRegistryErrorDomain, e.code()) ? e.code() : -1;
}

// A bundle directory at `path` with an Info.plist and an executable "main".
inline void makeBundle(const std::string& path, const TestBundle& b) {
  platform::Dictionary info{{platform::kBundleVersionKey, b.version}, {platform::kBundleExecutableKey, "main"}};
  if (!b.identifier.empty()) info[platform::kBundleIdentifierKey] = b.identifier;
  if (b.noDataContainer) info[platform::kNoDataContainerKey] = true;
  if (!b.groups.empty()) info[platform::kApplicationGroupsKey] = platform::Array(b.groups.begin(), b.groups.end());
  ASSERT_TRUE(makeDirs(path) && platform::plist::writeFile(info, platform::URL::fileURL(path + "/Info.plist")));
  ASSERT_TRUE(writeFile(path + "/main", "executable of " + b.identifier));
}

// Whether a path names anything, a dangling link included.
inline bool exists(const std::string& path) {
  std::error_code error;
  return std::filesystem::exists(std::filesystem::symlink_status(path, error));
}
MATCHER(PathExists, "names something") {
  return exists(arg);
}

class RegistryTest : public testing::Test {
 protected:
  using Registry = platform::SQLiteApplicationRegistry;
  std::string at(const std::string& relative) const { return base_ + "/" + relative; }

  std::unique_ptr<Registry> openRegistry() {
    platform::Error error;
    auto registry = Registry::open(base_, &error);
    EXPECT_TRUE(registry) << error.description();
    return registry;
  }
  // packages/<name>: Payload/App.app for `app`, Payload/Tunnel.vpnplugin for
  // `plugin` (when it has an identifier), store-metadata files beside Payload.
  std::string makePackage(const std::string& name, const TestBundle& app, const TestBundle& plugin = {},
                          const std::vector<std::string>& metadataFiles = {}) {
    std::string package = at("packages/" + name);
    makeBundle(package + "/Payload/App.app", app);
    if (!plugin.identifier.empty()) makeBundle(package + "/Payload/Tunnel.vpnplugin", plugin);
    for (const std::string& file : metadataFiles) EXPECT_TRUE(writeFile(package + "/" + file, "metadata " + file));
    return package;
  }
  // Installs a package for `identifier`, collecting the progress reports'
  // statuses and errors, and doing `action` when the status is `at`.
  bool install(Registry& registry, const std::string& package, const std::string& identifier,
               platform::Error* error = nullptr, const std::string& at = "", std::function<void()> action = {}) {
    statuses_.clear(), errors_.clear();
    return registry.installPackage(
        platform::URL::fileURL(package, true), installOptions(identifier),
        [&, this](const platform::Dictionary& report) {
          auto error = report.find(platform::kRegistryProgressErrorKey);
          if (error != report.end()) errors_.push_back(error->second.description());
          statuses_.push_back(report.at(platform::kRegistryProgressStatusKey).description());
          if (statuses_.back() == at) action();
        },
        error);
  }
  // Packs `b` into a fresh package and installs it, failing the test when
  // the registry refuses it.
  bool installApp(Registry& r, const TestBundle& b) {
    platform::Error error;
    const bool installed = install(r, makePackage(b.identifier + std::to_string(++made_), b), b.identifier, &error);
    EXPECT_TRUE(installed) << error.description();
    return installed;
  }

  std::vector<std::string> statuses_, errors_;

  std::string bundleContainers() const { return at("private/var/containers/Bundle/Application"); }
  std::string appDataContainers() const { return at("private/var/mobile/Containers/Data/Application"); }
  std::string groupContainers() const { return at("private/var/mobile/Containers/Shared/AppGroup"); }
  // Every container directory's entries, to compare before and after.
  std::vector<std::vector<std::string>> allContainers() const {
    return {entries(bundleContainers()), entries(appDataContainers()),
            entries(at("private/var/mobile/Containers/Data/PluginKitPlugin")), entries(groupContainers())};
  }

  TempDir root_{"registry"};
  std::string base_ = root_.path();  // the system root: the temporary directory unless a test names another
  int made_ = 0;                     // packages made by installApp
};

}  // namespace qstest
