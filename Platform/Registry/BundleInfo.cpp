#include "Platform/Registry/BundleInfo.h"

#include <charconv>

#include "Platform/BundleReader.h"
#include "Platform/Foundation/Format.h"
#include "Platform/Foundation/PropertyList.h"
#include "Platform/Registry/SQLiteRegistry.h"

namespace platform::registry {

namespace {

std::string stringOrEmpty(const Dictionary& info, std::string_view key) {
  auto it = info.find(key);
  const std::string* s = it == info.end() ? nullptr : it->second.asString();
  return s ? *s : std::string();
}

Error invalidInfoPlist(const std::string& message, const Error& underlying) {
  Dictionary info{{kLocalizedDescriptionKey, Value(message)}, {kUnderlyingErrorKey, Value(underlying)}};
  return Error(kRegistryErrorDomain, kRegistryErrorInvalidInfoPlist, std::move(info));
}

// The next dotted component of `rest` as a number (0 when it is not one),
// consuming it and its separator.
unsigned long long takeComponent(std::string_view* rest) {
  size_t dot = rest->find('.');
  std::string_view part = rest->substr(0, dot);
  *rest = dot == std::string_view::npos ? std::string_view() : rest->substr(dot + 1);
  unsigned long long value = 0;
  auto [end, ec] = std::from_chars(part.data(), part.data() + part.size(), value);
  return (ec == std::errc() && end == part.data() + part.size()) ? value : 0;
}

}  // namespace

std::optional<BundleInfo> readBundleInfo(const std::string& bundlePath, Error* error) {
  URL plistURL = URL::fileURL(bundlePath, true).appending(kInfoPlistFileName);
  Error readError;
  std::optional<Dictionary> dictionary = plist::readDictionary(plistURL, &readError);
  if (!dictionary) {
    if (error)
      *error = invalidInfoPlist(Format("Could not read %s: %s", plistURL.path(), readError.localizedDescription()),
                                readError);
    return std::nullopt;
  }
  BundleInfo info;
  info.identifier = stringOrEmpty(*dictionary, kBundleIdentifierKey);
  info.version = stringOrEmpty(*dictionary, kBundleVersionKey);
  info.displayName = stringOrEmpty(*dictionary, kBundleDisplayNameKey);
  if (auto groups = dictionary->find(kApplicationGroupsKey); groups != dictionary->end() && groups->second.asArray()) {
    for (const Value& group : *groups->second.asArray()) {
      if (const std::string* name = group.asString(); name && !name->empty()) info.groups.push_back(*name);
    }
  }
  auto noData = dictionary->find(kNoDataContainerKey);
  info.noDataContainer = noData != dictionary->end() && noData->second.boolValue(false);
  return info;
}

int compareBundleVersions(std::string_view a, std::string_view b) {
  while (!a.empty() || !b.empty()) {
    unsigned long long left = takeComponent(&a);
    unsigned long long right = takeComponent(&b);
    if (left != right) return left < right ? -1 : 1;
  }
  return 0;
}

}  // namespace platform::registry
