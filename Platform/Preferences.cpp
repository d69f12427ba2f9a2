#include "Platform/Preferences.h"

#include <cstdlib>

#include "Platform/Foundation/FileErrors.h"
#include "Platform/Foundation/PropertyList.h"

namespace platform {

namespace {

constexpr char kSystemRootVariable[] = "QS_SYSTEM_ROOT";
constexpr char kPreferencesDirectory[] = "private/var/quilld/Library/Preferences";
constexpr char kPreferencesExtension[] = ".plist";

// A domain names one file directly inside the preferences directory.
bool isValidDomainName(std::string_view domain) {
  return !domain.empty() && domain.find('/') == std::string_view::npos &&
         domain.find('\0') == std::string_view::npos && domain != "." && domain != "..";
}

}  // namespace

std::string normalizedSystemRoot(std::string_view root) {
  while (!root.empty() && root.back() == '/') root.remove_suffix(1);
  return std::string(root);
}

const std::string& systemRootFromEnvironment() {
  static const std::string* root = [] {
    const char* value = std::getenv(kSystemRootVariable);
    return new std::string(normalizedSystemRoot(value ? value : ""));
  }();
  return *root;
}

FilePreferenceStore::FilePreferenceStore(std::string systemRoot)
    : systemRoot_(normalizedSystemRoot(systemRoot)) {}

std::string FilePreferenceStore::pathForDomain(std::string_view domain) const {
  return systemRoot_ + "/" + kPreferencesDirectory + "/" + std::string(domain) + kPreferencesExtension;
}

std::optional<Dictionary> FilePreferenceStore::copyDomain(std::string_view domain, Error* error) const {
  URL url = URL::fileURL(pathForDomain(domain));
  if (!isValidDomainName(domain)) {
    failWith(error, FileReadError(url, "\"" + std::string(domain) + "\" is not a preference domain name"));
    return std::nullopt;
  }
  return plist::readDictionary(url, error);
}

std::optional<Value> FilePreferenceStore::copyValue(std::string_view key, std::string_view domain) {
  // An unreadable domain reads as an empty one.
  std::optional<Dictionary> values = copyDomain(domain);
  if (!values) return std::nullopt;
  auto it = values->find(key);
  if (it == values->end()) return std::nullopt;
  return std::move(it->second);
}

}  // namespace platform
