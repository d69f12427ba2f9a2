#include "Tools/devicegen/Layout.h"

#include "Platform/SystemVersion.h"
#include "Shared/Support/QSGlobalConfiguration.h"

namespace devicegen {
namespace {

std::string withoutTrailingSeparator(std::string path) {
  while (!path.empty() && path.back() == '/') path.pop_back();
  return path;
}

}  // namespace

DeviceLayout::DeviceLayout(std::string root)
    : root_(withoutTrailingSeparator(std::move(root))),
      preferences_(root_),
      configuration_(std::make_unique<QSGlobalConfiguration>(root_.empty() ? "/" : root_, preferences_)) {}

DeviceLayout::~DeviceLayout() = default;

std::string DeviceLayout::absolute(std::string_view relative) const {
  return root_ + "/" + std::string(relative);
}

std::string DeviceLayout::relative(std::string_view path) const {
  const std::string prefix = root_ + "/";
  if (path.substr(0, prefix.size()) != prefix) return "";
  return std::string(path.substr(prefix.size()));
}

std::string DeviceLayout::oldApplicationsDirectory() const {
  return configuration_->oldContainerPath().path();
}

std::string DeviceLayout::installMap() const {
  return configuration_->oldInstallMapPath().path();
}

// The path, not the accessor that creates the directory: the layout only
// names places, the image writer makes what it needs.
std::string DeviceLayout::dataDirectory() const {
  return configuration_->dataDirectoryPath().path();
}

std::string DeviceLayout::safeHarborMap() const {
  return dataDirectory() + "/" + kQSSafeHarborMapFileName;
}

std::string DeviceLayout::lastSystemVersionRecord() const {
  return dataDirectory() + "/" + kQSLastSystemVersionFileName;
}

std::string DeviceLayout::systemVersionFile() const {
  return platform::FileSystemVersionSource(root_).path();
}

std::string DeviceLayout::systemApplicationsDirectory() const {
  return configuration_->systemAppsDirectory().path();
}

std::string DeviceLayout::oldGroupContainersDirectory() const {
  return absolute(kOldGroupContainersRelativePath);
}

std::string DeviceLayout::safeHarborsDirectory() const {
  return absolute(kSafeHarborsRelativePath);
}

std::string DeviceLayout::manifest() const {
  return absolute(kManifestFileName);
}

}  // namespace devicegen
