// DeviceLayout: where the parts of a device image lie under its system root:
// the migrator's locations (old applications directory, old install map,
// data directory, system applications, item-name lists) as its configuration
// builds them and the image's own additions. The names of the files the
// migrator reads and writes there are the configuration's (QSLayoutNames.h).
//
// The migrator's own locations come from a QSGlobalConfiguration built for
// the root, so that the tools and the migrator cannot disagree.
//
// Thread safety: a DeviceLayout belongs to one thread.
#pragma once

#include <memory>
#include <string>
#include <string_view>

#include "Platform/Foundation/URL.h"
#include "Platform/Preferences.h"
#include "Shared/Support/QSLayoutNames.h"

class QSGlobalConfiguration;

namespace devicegen {

// The install map's entries of user applications (the migrator reads only
// the group-container entries).
inline constexpr char kInstallMapUserKey[] = "User";

// The image's own additions, relative to the root.
inline constexpr char kManifestFileName[] = "devicegen-manifest.plist";
inline constexpr char kOldGroupContainersRelativePath[] = "private/var/mobile/Library/AppGroups";
inline constexpr char kSafeHarborsRelativePath[] = "private/var/mobile/Library/SafeHarbors";

class DeviceLayout {
 public:
  // `root`: an absolute path without a trailing separator ("" or "/" is the
  // real root).
  explicit DeviceLayout(std::string root);
  ~DeviceLayout();
  DeviceLayout(const DeviceLayout&) = delete;
  DeviceLayout& operator=(const DeviceLayout&) = delete;

  const std::string& root() const { return root_; }
  // root + "/" + relative.
  std::string absolute(std::string_view relative) const;
  // The part of `path` below the root ("" when it is not below it).
  std::string relative(std::string_view path) const;

  std::string oldApplicationsDirectory() const;
  std::string installMap() const;
  std::string dataDirectory() const;
  std::string safeHarborMap() const;
  std::string lastSystemVersionRecord() const;
  std::string systemVersionFile() const;
  std::string systemApplicationsDirectory() const;
  std::string oldGroupContainersDirectory() const;
  std::string safeHarborsDirectory() const;
  std::string manifest() const;

 private:
  std::string root_;
  platform::FilePreferenceStore preferences_;
  std::unique_ptr<QSGlobalConfiguration> configuration_;
};

}  // namespace devicegen
