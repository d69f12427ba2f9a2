#include "Platform/RegistryFixture.h"

#include <algorithm>

#include "Platform/BundleReader.h"

namespace qstest {

using platform::Dictionary;
using platform::Value;

std::string infoPlistXML(const BundleSpec& bundle) {
  std::string xml =
      "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
      "<!DOCTYPE plist PUBLIC \"-//Apple//DTD PLIST 1.0//EN\" \"http://www.apple.com/DTDs/PropertyList-1.0.dtd\">\n"
      "<plist version=\"1.0\">\n<dict>\n";
  if (!bundle.identifier.empty()) xml += "<key>RkBundleIdentifier</key><string>" + bundle.identifier + "</string>\n";
  if (!bundle.version.empty()) xml += "<key>RkBundleVersion</key><string>" + bundle.version + "</string>\n";
  if (!bundle.displayName.empty()) xml += "<key>RkBundleDisplayName</key><string>" + bundle.displayName + "</string>\n";
  if (!bundle.groups.empty()) {
    xml += "<key>RkApplicationGroups</key><array>";
    for (const std::string& group : bundle.groups) xml += "<string>" + group + "</string>";
    xml += "</array>\n";
  }
  if (bundle.noDataContainer) xml += "<key>RkNoDataContainer</key><true/>\n";
  xml += "<key>RkBundleExecutable</key><string>main</string>\n</dict>\n</plist>\n";
  return xml;
}

std::unique_ptr<platform::SQLiteApplicationRegistry> RegistryTest::openRegistry() {
  platform::Error error;
  auto registry = platform::SQLiteApplicationRegistry::open(root(), &error);
  EXPECT_TRUE(registry) << error.description();
  return registry;
}

void RegistryTest::makeBundle(const std::string& path, const BundleSpec& bundle) {
  ASSERT_TRUE(makeDirs(path));
  ASSERT_TRUE(writeFile(path + "/" + platform::kInfoPlistFileName, infoPlistXML(bundle)));
  ASSERT_TRUE(writeFile(path + "/main", "executable of " + bundle.identifier));
}

std::string RegistryTest::makePackage(const std::string& name, const BundleSpec& app, const BundleSpec& plugin,
                                      const std::vector<std::string>& metadataFiles) {
  std::string package = at("packages/" + name);
  EXPECT_TRUE(makeDirs(package + "/Payload"));
  if (!app.identifier.empty()) makeBundle(package + "/Payload/App.app", app);
  if (!plugin.identifier.empty()) makeBundle(package + "/Payload/Tunnel.vpnplugin", plugin);
  for (const std::string& file : metadataFiles) EXPECT_TRUE(writeFile(package + "/" + file, "metadata " + file));
  return package;
}

std::string RegistryTest::makeBuiltIn(const std::string& name, const BundleSpec& bundle) {
  std::string path = at("Applications/" + name);
  makeBundle(path, bundle);
  return path;
}

bool RegistryTest::install(platform::SQLiteApplicationRegistry& registry, const std::string& package,
                           const std::string& identifier, platform::Error* error) {
  reports_.clear();
  reporterThreads_.clear();
  return registry.installPackage(
      platform::URL::fileURL(package, true), customerOptions(identifier),
      [this](const Dictionary& report) {
        reports_.push_back(report);
        reporterThreads_.push_back(std::this_thread::get_id());
      },
      error);
}

bool RegistryTest::installApp(platform::SQLiteApplicationRegistry& registry, const BundleSpec& bundle,
                              const BundleSpec& plugin) {
  std::string package = makePackage(bundle.identifier + "-" + std::to_string(++packages_), bundle, plugin);
  platform::Error error;
  bool installed = install(registry, package, bundle.identifier, &error);
  EXPECT_TRUE(installed) << error.description();
  return installed;
}

std::vector<std::string> RegistryTest::entries(const std::string& directory) {
  std::vector<std::string> names;
  std::error_code missing;
  for (const auto& entry : std::filesystem::directory_iterator(directory, missing)) {
    names.push_back(entry.path().filename());
  }
  std::sort(names.begin(), names.end());
  return names;
}

Dictionary customerOptions(const std::string& identifier) {
  return Dictionary{{platform::kRegistryInstallTypeKey, Value(6u)},
                    {platform::kRegistryPackageTypeKey, Value(platform::kRegistryPackageTypeCustomer)},
                    {"VerifyForMigrator", Value(true)},
                    {"SkipBlacklist", Value(true)},
                    {platform::kBundleIdentifierKey, Value(identifier)}};
}

std::vector<std::string> reportValues(const std::vector<Dictionary>& reports, const char* key) {
  std::vector<std::string> values;
  for (const Dictionary& report : reports) {
    auto it = report.find(key);
    if (it != report.end() && it->second.asString()) values.push_back(*it->second.asString());
  }
  return values;
}

}  // namespace qstest
