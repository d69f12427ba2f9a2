// The writer of old-layout device images.
//
// An image holds, under its root: the old applications directory with one
// container per application (bundle, optional VPN plug-in, user data, store
// metadata), containers that hold only a VPN plug-in, placeholder bundles,
// old group containers with the install map that records them, safe-harbor
// directories with the safe-harbor map, built-in applications (some of them
// newer copies of old applications, which the registry must refuse to
// downgrade), the system version, and the manifest of every user item.
// Everything is derived from the seed: two images made with the same options
// are identical apart from the root they lie under.
#pragma once

#include <cstdint>
#include <string>

#include "Tools/devicegen/Manifest.h"

namespace devicegen {

struct ImageOptions {
  std::string root;  // canonical absolute path of an existing directory
  uint64_t applications = 0;
  uint64_t vpnOnly = 0;
  uint64_t groups = 0;
  uint64_t filesPerApp = 6;
  uint64_t bytesPerFile = 4096;
  uint64_t harbors = 0;
  uint64_t placeholders = 0;
  uint64_t builtInOlder = 0;
  uint64_t seed = 1;
};

// Limits that keep a mistyped option from filling the disk.
inline constexpr uint64_t kMaximumApplications = 100000;
inline constexpr uint64_t kMaximumFilesPerApp = 100000;
inline constexpr uint64_t kMaximumBytesPerFile = 1ULL << 30;

// "" when the options describe an image that can be made; otherwise why not
// (a usage error: the numbers do not fit together).
std::string checkImageOptions(const ImageOptions& options);

// Writes the image and its manifest. REQUIRES: checkImageOptions() == "".
// False with *why on the first failure; what was written so far stays.
[[nodiscard]] bool createImage(const ImageOptions& options, Manifest* manifest, std::string* why);

}  // namespace devicegen
