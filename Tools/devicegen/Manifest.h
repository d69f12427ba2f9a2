// The manifest of a device image: everything devicegen wrote that a migration
// must carry over, and what it should find afterwards. It is a property list
// (XML) at <root>/devicegen-manifest.plist; every path in it is relative to
// the root (or to a container), so images made with one seed under different
// roots have identical manifests. docs/devicegen.md describes the format.
//
// Thread safety: plain values.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "Platform/Foundation/Value.h"
#include "Platform/Digest.h"

namespace devicegen {

inline constexpr int64_t kManifestFormatVersion = 1;

// One old container of the image.
struct ManifestContainer {
  enum class Kind { Application, VPNOnly };
  Kind kind = Kind::Application;
  // The identifier whose record receives the container's data: the
  // application's, or the plug-in's for a VPN-only container.
  std::string identifier;
  std::string containerPath;  // relative to the root
  std::string bundleName;     // "<Name>.app" or "<Plugin>.vpnplugin"
  std::string version;
  bool placeholder = false;         // the bundle carries the placeholder mark
  bool builtInRefusal = false;      // a built-in copy is equal or newer: the registry refuses
  std::string vpnPluginIdentifier;  // applications carrying a plug-in; "" otherwise
  std::vector<std::string> groups;
  bool storeMetadata = false;
};

struct ManifestGroup {
  std::string identifier;
  std::string containerPath;  // relative to the root
  std::vector<std::string> members;
};

struct ManifestHarbor {
  std::string identifier;
  std::string path;  // relative to the root
};

struct ManifestBuiltIn {
  std::string identifier;
  std::string bundlePath;  // relative to the root
  std::string version;
  bool noDataContainer = false;
};

// One user item: a file, a directory or a symbolic link below a container.
struct ManifestItem {
  enum class Owner { Application, Group };
  enum class Kind { File, Directory, Link };
  Owner owner = Owner::Application;
  Kind kind = Kind::File;
  std::string ownerIdentifier;  // record identifier, or group identifier
  std::string path;             // relative to the container; any bytes
  uint64_t size = 0;
  platform::SHA256Digest digest{};
  std::string linkTarget;
};

struct Manifest {
  uint64_t seed = 0;
  platform::Dictionary systemVersion;
  std::vector<ManifestContainer> containers;
  std::vector<ManifestGroup> groups;
  std::vector<ManifestHarbor> harbors;
  std::vector<ManifestBuiltIn> builtIns;
  std::vector<ManifestItem> items;

  uint64_t fileCount() const;
  uint64_t byteCount() const;
};

platform::Value manifestToValue(const Manifest& manifest);
// None with *why when the value is not a manifest this version understands.
std::optional<Manifest> manifestFromValue(const platform::Value& value, std::string* why);

[[nodiscard]] bool writeManifest(const Manifest& manifest, const std::string& path, std::string* why);
std::optional<Manifest> readManifest(const std::string& path, std::string* why);

}  // namespace devicegen
