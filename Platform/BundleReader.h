// The bundle reader: a bundle is a directory holding "Info.plist" (XML or
// binary).
//
// BundleReader is an interface so that unit tests can substitute failures;
// FileBundleReader reads the file system.
//
// Thread safety: FileBundleReader keeps no shared state; bundle objects are
// immutable after opening.
#pragma once

#include <memory>
#include <optional>
#include <set>
#include <string>

#include "Platform/Foundation/URL.h"
#include "Platform/Foundation/Value.h"

namespace platform {

// Info.plist keys of the bundle format.
inline constexpr char kBundleIdentifierKey[] = "RkBundleIdentifier";
inline constexpr char kBundleDisplayNameKey[] = "RkBundleDisplayName";
inline constexpr char kBundleExecutableKey[] = "RkBundleExecutable";
inline constexpr char kBundleVersionKey[] = "RkBundleVersion";
inline constexpr char kBundleShortVersionStringKey[] = "RkBundleShortVersionString";
inline constexpr char kBundleIconFileKey[] = "RkBundleIconFile";
inline constexpr char kApplicationGroupsKey[] = "RkApplicationGroups";
inline constexpr char kNoDataContainerKey[] = "RkNoDataContainer";
// Added by the reader to the info dictionary: the Info.plist's own URL.
inline constexpr char kBundleInfoPlistURLKey[] = "RkBundleInfoPlistURL";
inline constexpr char kInfoPlistFileName[] = "Info.plist";
// Path extensions of application bundles and VPN plug-in bundles.
inline constexpr char kApplicationBundleExtension[] = "app";
inline constexpr char kVPNPluginBundleExtension[] = "vpnplugin";

// An open bundle: its location and its info dictionary as read at opening
// (none when the Info.plist could not be read as a dictionary).
class Bundle {
 public:
  Bundle(URL url, std::optional<Dictionary> info) : url_(std::move(url)), info_(std::move(info)) {}
  const URL& url() const { return url_; }
  const std::optional<Dictionary>& info() const { return info_; }
  // The identifier from the info dictionary, or none.
  std::optional<std::string> identifier() const;
  // "RkBundle <path> (not loaded)"
  std::string description() const;

 private:
  URL url_;
  std::optional<Dictionary> info_;
};

class BundleReader {
 public:
  virtual ~BundleReader() = default;
  // Opens the bundle directory at `url`; none when it is not a directory.
  virtual std::shared_ptr<Bundle> openBundle(const URL& url) = 0;
  // The info dictionary with kBundleInfoPlistURLKey added, or none.
  virtual std::optional<Dictionary> infoDictionary(const Bundle& bundle) = 0;
  // The Info.plist restricted to `keys`, read afresh; none when it cannot be
  // read. The root is returned as read, whatever its type.
  virtual std::optional<Value> filteredInfoPlist(const Bundle& bundle, const std::set<std::string>& keys) = 0;
};

class FileBundleReader final : public BundleReader {
 public:
  std::shared_ptr<Bundle> openBundle(const URL& url) override;
  std::optional<Dictionary> infoDictionary(const Bundle& bundle) override;
  std::optional<Value> filteredInfoPlist(const Bundle& bundle, const std::set<std::string>& keys) override;
};

}  // namespace platform
