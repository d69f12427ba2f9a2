// The preference store: values of a preference domain for the current user
// and host.
//
// The Linux store keeps a domain as the property list
// <root>/private/var/quilld/Library/Preferences/<domain>.plist.
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "Platform/Foundation/Error.h"
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
  // The whole domain, or none with *error (kFileErrorDomain, as
  // plist::readDictionary reports it; 256 for a domain name that is empty or
  // holds a separator or NUL) when its file cannot be read as a dictionary.
  std::optional<Dictionary> copyDomain(std::string_view domain, Error* error = nullptr) const;

 private:
  std::string systemRoot_;
};

// The system root named by QS_SYSTEM_ROOT, without a trailing separator ("" for
// "/" and when the variable is unset), read once per process; safe to call
// from any thread.
const std::string& systemRootFromEnvironment();

// `root` without trailing separators ("/" and "///" give "").
std::string normalizedSystemRoot(std::string_view root);

}  // namespace platform
