#include "Platform/Registry/BuiltInApplications.h"

#include <sys/stat.h>

#include "Platform/Foundation/URL.h"
#include "Platform/Registry/RegistryFiles.h"

namespace platform::registry {

std::optional<BuiltInApplication> BuiltInApplications::find(const std::string& identifier) {
  std::lock_guard lock(mutex_);
  refreshLocked();
  auto it = byIdentifier_.find(identifier);
  if (it == byIdentifier_.end()) return std::nullopt;
  return it->second;
}

std::vector<BuiltInApplication> BuiltInApplications::all() {
  std::lock_guard lock(mutex_);
  refreshLocked();
  std::vector<BuiltInApplication> out;
  for (const auto& [identifier, application] : byIdentifier_) out.push_back(application);
  return out;
}

void BuiltInApplications::refreshLocked() {
  struct stat st;
  if (stat(directory_.c_str(), &st) != 0) {
    // No system applications directory: no built-in applications.
    byIdentifier_.clear();
    loaded_ = false;
    return;
  }
  if (loaded_ && st.st_mtim.tv_sec == modified_.tv_sec && st.st_mtim.tv_nsec == modified_.tv_nsec) return;
  byIdentifier_.clear();
  std::optional<std::vector<std::string>> names = listDirectory(directory_, nullptr);
  for (const std::string& name : names.value_or(std::vector<std::string>())) {
    std::string bundlePath = path::join(directory_, name);
    if (URL::fileURL(bundlePath).pathExtension() != kApplicationBundleExtension) continue;
    // A bundle without a readable Info.plist is no application the registry
    // can report.
    std::optional<BundleInfo> info = readBundleInfo(bundlePath, nullptr);
    if (info && !info->identifier.empty()) {
      std::string identifier = info->identifier;
      byIdentifier_[identifier] = BuiltInApplication{std::move(bundlePath), std::move(*info)};
    }
  }
  loaded_ = names.has_value();
  modified_ = st.st_mtim;
}

}  // namespace platform::registry
