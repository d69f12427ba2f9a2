// The preference store: values of a preference domain for the current user
// and host.
//
// The Linux store keeps a domain as the property list
// <root>/private/var/quilld/Library/Preferences/<domain>.plist.
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "Platform/Foundation/Value.h"

namespace platform {

class PreferenceStore {
 public:
  virtual ~PreferenceStore() = default;
  // A copy of the value stored under `key` in `domain`, or none when the key
  // (or the whole domain) is absent. An unreadable domain file reads as empty.
  virtual std::optional<Value> copyValue(std::string_view key, std::string_view domain) = 0;
};

// The store backed by property-list files under `systemRoot` ("" or "/" for
// the real root). Thread-safe: each call reads the file afresh.
class FilePreferenceStore final : public PreferenceStore {
 public:
  explicit FilePreferenceStore(std::string systemRoot);
  std::optional<Value> copyValue(std::string_view key, std::string_view domain) override;
  // Where `domain` is kept.
  std::string pathForDomain(std::string_view domain) const;

 private:
  std::string systemRoot_;
};

// The system root named by QS_SYSTEM_ROOT, without a trailing separator ("" for
// "/"), read once per process.
const std::string& systemRootFromEnvironment();

}  // namespace platform
