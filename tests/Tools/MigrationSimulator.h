// Carries a devicegen image into the new layout by hand, through the real
// registry, the way a migration would: each application installed (a
// placeholder bundle as a placeholder), its user data moved into the data
// container the registry assigns, group containers emptied into the new
// ones, safe harbors registered, the old layout removed and the system
// version recorded. The verifier's tests start from such a tree and then
// damage it.
#pragma once

#include <stdio.h>
#include <unistd.h>

#include "Platform/RegistryFixture.h"
#include "ToolTestSupport.h"

namespace tooltest {

// Moves `from` over `to`; "" on success, otherwise what failed.
inline std::string moveItem(const std::string& from, const std::string& to) {
  std::error_code error;
  fs::remove_all(to, error);
  return rename(from.c_str(), to.c_str()) == 0 ? "" : "rename " + from + " -> " + to + " failed";
}

// Installs the container's application as the migrator would: a placeholder
// bundle in place, otherwise a package staged from the bundle, its plug-ins
// and store metadata (a refusal in favour of a built-in copy is no failure).
inline std::string installContainer(platform::SQLiteApplicationRegistry& registry, const Dictionary& c,
                                    const std::string& container) {
  const std::string identifier = stringAt(c, "Identifier"), bundle = stringAt(c, "Bundle");
  platform::Error error;
  if (c.at("Placeholder").boolValue()) {
    const Dictionary options{{platform::kRegistryPackageTypeKey, platform::kRegistryPackageTypePlaceholder},
                             {platform::kBundleIdentifierKey, identifier}};
    return registry.installBundle(platform::URL::fileURL(container + "/" + bundle, true), options, &error)
               ? ""
               : "placeholder " + identifier + ": " + error.description();
  }
  const std::string staging = container + "/Staging";
  std::string failed = qstest::makeDirs(staging + "/Payload") ? "" : "mkdir " + staging;
  for (const std::string& name : listDirectory(container)) {
    const bool payload = name == bundle || name.ends_with(".vpnplugin");
    const bool metadata = name == "Manifest.plist" || name.starts_with("Vendra") || name == "GeoJSON";
    if (failed.empty() && (payload || metadata)) {
      failed = moveItem(container + "/" + name, staging + (payload ? "/Payload/" : "/") + name);
    }
  }
  if (!failed.empty()) return failed;
  bool refused = false;
  const bool installed = registry.installPackage(
      platform::URL::fileURL(staging, true), qstest::customerOptions(identifier),
      [&](const Dictionary& progress) {
        auto e = progress.find(platform::kRegistryProgressErrorKey);
        refused |= e != progress.end() && e->second == Value(platform::kRegistryErrorApplicationAlreadyInstalled);
      },
      &error);
  return installed || refused ? "" : "install " + identifier + ": " + error.description();
}

// Moves every entry of `old` into `destination` and removes `old`.
inline std::string moveEntries(const std::string& old, const std::string& destination) {
  for (const std::string& name : listDirectory(old)) {
    if (std::string failed = moveItem(old + "/" + name, destination + "/" + name); !failed.empty()) return failed;
  }
  std::error_code error;
  fs::remove_all(old, error);
  return error ? "cannot remove " + old : "";
}

// "" on success, otherwise what failed.
inline std::string simulateMigration(const std::string& root) {
  platform::Error error;
  auto registry = platform::SQLiteApplicationRegistry::open(root, &error);
  if (!registry) return "open the registry: " + error.description();
  const Dictionary manifest = readDictionary(root + kManifest);
  // Applications first: VPN-only containers need the plug-in records that
  // the applications carrying the plug-ins bring.
  for (const char* kind : {"App", "VPNOnly"}) {
    for (const Value& v : arrayAt(manifest, "Containers")) {
      const Dictionary& c = *v.asDictionary();
      const std::string container = root + "/" + stringAt(c, "Container");
      if (stringAt(c, "Kind") != kind) continue;
      if (std::string failed = installContainer(*registry, c, container); !failed.empty()) return failed;
      const auto record = registry->recordForIdentifier(stringAt(c, "Identifier"));
      if (!record || !record->dataContainerURL) return "no data container for " + stringAt(c, "Identifier");
      for (const char* item : {"Documents", "Library", "tmp", "Tillbox"}) {
        if (!exists(container + "/" + item)) continue;
        if (std::string failed = moveItem(container + "/" + item, record->dataContainerURL->path() + "/" + item);
            !failed.empty()) {
          return failed;
        }
      }
    }
  }
  for (const Value& v : arrayAt(manifest, "Groups")) {
    const Dictionary& g = *v.asDictionary();
    const std::string group = stringAt(g, "Identifier");
    const auto member = registry->recordForIdentifier(*arrayAt(g, "Members").at(0).asString());
    if (!member || !member->groupContainerURLs || !member->groupContainerURLs->count(group)) {
      return "no group container for " + group;
    }
    std::string failed =
        moveEntries(root + "/" + stringAt(g, "Container"), member->groupContainerURLs->at(group).path());
    if (!failed.empty()) return failed;
  }
  for (const Value& v : arrayAt(manifest, "SafeHarbors")) {
    const Dictionary& h = *v.asDictionary();
    if (!registry->QuillsetRegisterSafeHarborForContainerType(root + "/" + stringAt(h, "Path"),
                                                              stringAt(h, "Identifier"), 2, nullptr)) {
      return "safe harbor " + stringAt(h, "Identifier") + " refused";
    }
  }
  std::error_code removal;
  fs::remove_all(root + kOldApplications, removal);
  unlink((root + kSafeHarborMap).c_str());
  unlink((root + kInstallMap).c_str());
  return qstest::writeFile(root + kLastSystemVersion, qstest::readFile(root + kSystemVersion)) ? "" : "version";
}

}  // namespace tooltest
