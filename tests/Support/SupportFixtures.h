// Helpers shared by the runtime-support tests: an in-memory preference store,
// a scoped log handle, and writers for bundles and synthetic device trees.
#pragma once

#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "Platform/Foundation/Value.h"
#include "Platform/Preferences.h"
#include "Shared/Support/QSLog.h"

namespace supporttest {

// Preferences held in memory; remembers which domains were asked.
class MemoryPreferenceStore final : public platform::PreferenceStore {
 public:
  void set(const std::string& key, platform::Value value) { values_[key] = std::move(value); }
  std::optional<platform::Value> copyValue(std::string_view key, std::string_view domain) override {
    std::lock_guard<std::mutex> lock(mutex_);
    domains_.emplace_back(domain);
    auto it = values_.find(std::string(key));
    if (it == values_.end()) return std::nullopt;
    return it->second;
  }
  std::vector<std::string> domainsAsked() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return domains_;
  }

 private:
  std::map<std::string, platform::Value> values_;
  mutable std::mutex mutex_;
  std::vector<std::string> domains_;
};

// Sets gLogHandle to a handle of `level` (or to none) for its lifetime.
class ScopedLogHandle {
 public:
  explicit ScopedLogHandle(std::optional<int> level) : previous_(gLogHandle.load()) {
    if (level) {
      handle_.level.store(*level);
      gLogHandle.store(&handle_);
    } else {
      gLogHandle.store(nullptr);
    }
  }
  ~ScopedLogHandle() { gLogHandle.store(previous_); }
  ScopedLogHandle(const ScopedLogHandle&) = delete;
  ScopedLogHandle& operator=(const ScopedLogHandle&) = delete;

 private:
  platform::LogHandle handle_;
  platform::LogHandle* previous_;
};

// Writes an XML property list holding a dictionary of string entries.
bool writeStringDictionaryPlist(const std::string& path, const std::map<std::string, std::string>& entries);
// Writes an XML property list whose root is an array of strings.
bool writeStringArrayPlist(const std::string& path, const std::vector<std::string>& items);
// Makes `directory` a bundle whose Info.plist holds `entries`.
bool makeBundle(const std::string& directory, const std::map<std::string, std::string>& entries);

// Reads the data-protection class attribute of `path`: the class, or none
// when the attribute is absent.
std::optional<int32_t> protectionClassOf(const std::string& path);

}  // namespace supporttest
