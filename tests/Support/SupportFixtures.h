// Helpers shared by the runtime-support tests: an in-memory preference store,
// a scoped log handle, and a bundle writer.
#pragma once

#include <map>

#include "Platform/Foundation/PropertyList.h"
#include "Platform/Preferences.h"
#include "Shared/Support/QSLog.h"
#include "support/TestSupport.h"

namespace supporttest {

// Preferences held in memory; remembers which domains were asked. Not thread-safe.
class MemoryPreferenceStore final : public platform::PreferenceStore {
 public:
  explicit MemoryPreferenceStore(std::map<std::string, platform::Value> values = {}) : values(std::move(values)) {}
  std::optional<platform::Value> copyValue(std::string_view key, std::string_view domain) override {
    domains.emplace_back(domain);
    auto it = values.find(std::string(key));
    return it == values.end() ? std::nullopt : std::optional<platform::Value>(it->second);
  }
  std::map<std::string, platform::Value> values;
  std::vector<std::string> domains;
};

// Sets gLogHandle to a handle of `level` (or to none) for its lifetime.
class ScopedLogHandle {
 public:
  explicit ScopedLogHandle(std::optional<int> level) : previous_(gLogHandle.load()) {
    handle_.level.store(level.value_or(0));
    gLogHandle.store(level ? &handle_ : nullptr);
  }
  ~ScopedLogHandle() { gLogHandle.store(previous_); }

 private:
  platform::LogHandle handle_;
  platform::LogHandle* previous_;
};

// Makes `directory` a bundle whose Info.plist holds `entries`.
inline bool makeBundle(const std::string& directory, const platform::Dictionary& entries) {
  return qstest::makeDirs(directory) &&
         platform::plist::writeFile(platform::Value(entries), platform::URL::fileURL(directory + "/Info.plist"));
}

}  // namespace supporttest
