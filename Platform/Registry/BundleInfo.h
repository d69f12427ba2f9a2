// What the registry reads from a bundle's Info.plist, and how it orders
// bundle versions.
//
// Thread safety: the functions keep no state.
#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "Platform/BundleReader.h"
#include "Platform/Foundation/Error.h"

namespace platform::registry {

struct BundleInfo {
  std::string identifier;
  std::string version;              // RkBundleVersion, "" when absent
  std::string displayName;          // RkBundleDisplayName, "" when absent
  std::vector<std::string> groups;  // RkApplicationGroups (string entries only)
  bool noDataContainer = false;     // RkNoDataContainer
};

// Reads the Info.plist of the bundle directory at `bundlePath`. Fails with
// kRegistryErrorInvalidInfoPlist (the read error underneath) when it cannot be
// read or is not a dictionary. `identifier` is "" when the Info.plist holds no
// string identifier; callers that need one check.
std::optional<BundleInfo> readBundleInfo(const std::string& bundlePath, Error* error);

// Compares dotted version strings numerically, component by component; a
// missing component counts as 0 and so does one that is not a number
// ("1.10" > "1.9", "2" == "2.0"). Negative, zero or positive like strcmp.
int compareBundleVersions(std::string_view a, std::string_view b);

// True when a built-in copy at `builtInVersion` keeps a bundle at `version`
// from being installed (the built-in copy is equal or newer).
inline bool builtInSupersedes(std::string_view builtInVersion, std::string_view version) {
  return compareBundleVersions(builtInVersion, version) >= 0;
}

}  // namespace platform::registry
