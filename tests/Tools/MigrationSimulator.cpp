#include "MigrationSimulator.h"

#include <stdio.h>
#include <sys/stat.h>

#include "Platform/BundleReader.h"
#include "Platform/Registry/SQLiteRegistry.h"
#include "ToolTestSupport.h"
#include "support/TestSupport.h"

namespace tooltest {
namespace {

using platform::Dictionary;
using platform::URL;
using platform::Value;

constexpr const char* kUserDataItems[] = {"Documents", "Library", "tmp", "Tillbox"};
constexpr const char* kStoreMetadataItems[] = {"Manifest.plist", "VendraArtwork", "VendraMetadata.plist", "GeoJSON"};
constexpr unsigned long long kInstallType = 6;
constexpr int kHarborContainerType = 2;

std::string moveItem(const std::string& from, const std::string& to) {
  removeTree(to);
  if (rename(from.c_str(), to.c_str()) != 0) return "rename " + from + " -> " + to + " failed";
  return "";
}

std::string installContainer(platform::SQLiteApplicationRegistry& registry, const Dictionary& c,
                             const std::string& root) {
  const std::string identifier = stringAt(c, "Identifier");
  const std::string container = root + "/" + stringAt(c, "Container");
  const std::string bundle = container + "/" + stringAt(c, "Bundle");
  platform::Error error;
  if (c.at("Placeholder").boolValue()) {
    const Dictionary options{{platform::kRegistryInstallTypeKey, Value(kInstallType)},
                             {platform::kRegistryPackageTypeKey, platform::kRegistryPackageTypePlaceholder},
                             {platform::kBundleIdentifierKey, identifier}};
    if (!registry.installBundle(URL::fileURL(bundle, true), options, &error)) {
      return "placeholder " + identifier + ": " + error.description();
    }
    return "";
  }
  const std::string staging = container + "/Staging";
  if (!qstest::makeDirs(staging + "/Payload")) return "mkdir " + staging;
  std::string failed = moveItem(bundle, staging + "/Payload/" + stringAt(c, "Bundle"));
  for (const std::string& name : listDirectory(container)) {
    if (failed.empty() && name.ends_with(".vpnplugin"))
      failed = moveItem(container + "/" + name, staging + "/Payload/" + name);
  }
  for (const char* name : kStoreMetadataItems) {
    if (failed.empty() && exists(container + "/" + name))
      failed = moveItem(container + "/" + name, staging + "/" + name);
  }
  if (!failed.empty()) return failed;
  const Dictionary options{{platform::kRegistryInstallTypeKey, Value(kInstallType)},
                           {platform::kRegistryPackageTypeKey, platform::kRegistryPackageTypeCustomer},
                           {"VerifyForMigrator", true},
                           {"SkipBlacklist", true},
                           {platform::kBundleIdentifierKey, identifier}};
  bool alreadyInstalled = false;
  const bool installed = registry.installPackage(
      URL::fileURL(staging, true), options,
      [&](const Dictionary& progress) {
        auto e = progress.find(platform::kRegistryProgressErrorKey);
        if (e != progress.end() && e->second == Value(platform::kRegistryErrorApplicationAlreadyInstalled)) {
          alreadyInstalled = true;
        }
      },
      &error);
  if (!installed && !alreadyInstalled) return "install " + identifier + ": " + error.description();
  return "";
}

std::string moveUserData(platform::SQLiteApplicationRegistry& registry, const Dictionary& c, const std::string& root) {
  const std::string identifier = stringAt(c, "Identifier");
  const auto record = registry.recordForIdentifier(identifier);
  if (!record || !record->dataContainerURL) return "no data container for " + identifier;
  const std::string container = root + "/" + stringAt(c, "Container");
  for (const char* item : kUserDataItems) {
    if (!exists(container + "/" + item)) continue;
    if (std::string failed = moveItem(container + "/" + item, record->dataContainerURL->path() + "/" + item);
        !failed.empty()) {
      return failed;
    }
  }
  return removeTree(container) ? "" : "cannot remove " + container;
}

std::string moveGroup(platform::SQLiteApplicationRegistry& registry, const Dictionary& g, const std::string& root) {
  const std::string group = stringAt(g, "Identifier");
  std::string destination;
  for (const Value& member : arrayAt(g, "Members")) {
    const auto record = registry.recordForIdentifier(*member.asString());
    if (record && record->groupContainerURLs && record->groupContainerURLs->count(group)) {
      destination = record->groupContainerURLs->at(group).path();
    }
  }
  if (destination.empty()) return "no group container for " + group;
  const std::string old = root + "/" + stringAt(g, "Container");
  for (const std::string& name : listDirectory(old)) {
    if (std::string failed = moveItem(old + "/" + name, destination + "/" + name); !failed.empty()) return failed;
  }
  return removeTree(old) ? "" : "cannot remove " + old;
}

}  // namespace

std::string simulateMigration(const std::string& root) {
  platform::Error error;
  auto registry = platform::SQLiteApplicationRegistry::open(root, &error);
  if (!registry) return "open the registry: " + error.description();
  const Dictionary manifest = readDictionary(root + kManifest);
  // Applications first: VPN-only containers need the plug-in records that
  // the applications carrying the plug-ins bring.
  for (const char* kind : {"App", "VPNOnly"}) {
    for (const Value& v : arrayAt(manifest, "Containers")) {
      const Dictionary& c = *v.asDictionary();
      if (stringAt(c, "Kind") != kind) continue;
      if (std::string failed = installContainer(*registry, c, root); !failed.empty()) return failed;
      if (std::string failed = moveUserData(*registry, c, root); !failed.empty()) return failed;
    }
  }
  for (const Value& v : arrayAt(manifest, "Groups")) {
    if (std::string failed = moveGroup(*registry, *v.asDictionary(), root); !failed.empty()) return failed;
  }
  for (const Value& v : arrayAt(manifest, "SafeHarbors")) {
    const Dictionary& h = *v.asDictionary();
    if (!registry->QuillsetRegisterSafeHarborForContainerType(
            root + "/" + stringAt(h, "Path"), stringAt(h, "Identifier"), kHarborContainerType, nullptr)) {
      return "safe harbor " + stringAt(h, "Identifier") + " refused";
    }
  }
  unlink((root + kSafeHarborMap).c_str());
  if (!removeTree(root + kOldApplications)) return "cannot remove the old applications directory";
  unlink((root + kInstallMap).c_str());
  if (!qstest::writeFile(root + kLastSystemVersion, qstest::readFile(root + kSystemVersion)))
    return "cannot record the version";
  return "";
}

}  // namespace tooltest
