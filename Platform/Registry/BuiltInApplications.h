// The applications built into the system: the *.app bundles of the system
// applications directory (<root>/Applications).
//
// The inventory is read on first use and read again whenever the directory's
// modification time changes (a bundle added, removed or renamed); changes
// inside a bundle's Info.plist alone are not noticed until then.
//
// Thread safety: every member may be called from any thread; the cached
// inventory is guarded by the object's own lock.
#pragma once

#include <ctime>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "Platform/Registry/BundleInfo.h"

namespace platform::registry {

struct BuiltInApplication {
  std::string bundlePath;
  BundleInfo info;
};

class BuiltInApplications {
 public:
  explicit BuiltInApplications(std::string directory) : directory_(std::move(directory)) {}

  std::optional<BuiltInApplication> find(const std::string& identifier);
  // Every built-in application, ordered by identifier.
  std::vector<BuiltInApplication> all();

 private:
  // Rescans when the directory changed. REQUIRES: mutex_ held.
  void refreshLocked();

  const std::string directory_;
  std::mutex mutex_;  // guards everything below
  bool loaded_ = false;
  timespec modified_{};
  // Identifier to application; when two bundles carry one identifier, the
  // later name in sorted order wins.
  std::map<std::string, BuiltInApplication> byIdentifier_;
};

}  // namespace platform::registry
