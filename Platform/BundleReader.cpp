#include "Platform/BundleReader.h"

#include <sys/stat.h>

#include "Platform/Foundation/Format.h"
#include "Platform/Foundation/PropertyList.h"

namespace platform {

namespace {

constexpr char kBundleDescriptionFormat[] = "RkBundle %s (not loaded)";

URL infoPlistURL(const URL& bundle) {
  return bundle.appending(kInfoPlistFileName);
}

}  // namespace

std::optional<std::string> Bundle::identifier() const {
  if (!info_) return std::nullopt;
  auto it = info_->find(kBundleIdentifierKey);
  if (it == info_->end() || !it->second.isString()) return std::nullopt;
  return *it->second.asString();
}

std::string Bundle::description() const {
  return Format(kBundleDescriptionFormat, url_.path());
}

std::shared_ptr<Bundle> FileBundleReader::openBundle(const URL& url) {
  struct stat st;
  if (url.empty() || stat(url.fileSystemRepresentation(), &st) != 0 || !S_ISDIR(st.st_mode)) return nullptr;
  URL directory = URL::fileURL(url.path(), true);
  return std::make_shared<Bundle>(directory, plist::readDictionary(infoPlistURL(directory)));
}

std::optional<Dictionary> FileBundleReader::infoDictionary(const Bundle& bundle) {
  if (!bundle.info()) return std::nullopt;
  Dictionary info = *bundle.info();
  info[kBundleInfoPlistURLKey] = Value(infoPlistURL(bundle.url()));
  return info;
}

std::optional<Value> FileBundleReader::filteredInfoPlist(const Bundle& bundle, const std::set<std::string>& keys) {
  std::optional<Value> root = plist::readFile(infoPlistURL(bundle.url()));
  if (!root || !root->isDictionary()) return root;
  Dictionary filtered;
  for (const auto& [key, value] : *root->asDictionary()) {
    if (keys.count(key)) filtered.emplace(key, value);
  }
  return Value(std::move(filtered));
}

}  // namespace platform
