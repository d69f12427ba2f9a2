#include <mutex>

#include "Shared/FileManager/QSFileManager.h"
#include "Shared/Support/QSLog.h"
#include "Shared/Support/QSUtilities.h"

using platform::Dictionary;
using platform::URL;
using platform::Value;

namespace {

constexpr char kLoadInfoPlistFunction[] = "QSLoadInfoPlist";

// Serialises every bundle open and Info.plist read of the process.
std::mutex& bundleReadLock() {
  static auto* lock = new std::mutex;
  return *lock;
}

platform::BundleReader& processBundleReader() {
  static auto* reader = new platform::FileBundleReader;
  return *reader;
}

Value describableKeys(const std::set<std::string>& keys) {
  platform::Array array(keys.begin(), keys.end());
  return Value(std::move(array));
}

std::optional<Dictionary> readWholeInfo(platform::BundleReader& reader, const platform::Bundle& bundle,
                                        const URL& bundleURL) {
  std::optional<Dictionary> info = reader.infoDictionary(bundle);
  if (!info) {
    QS_SYSLOG(kQSLogLevelError, kLoadInfoPlistFunction, "RkBundleGetInfoDictionary failed for bundle %@", bundleURL);
    return std::nullopt;
  }
  info->erase(platform::kBundleInfoPlistURLKey);
  return info;
}

std::optional<Dictionary> readFilteredInfo(platform::BundleReader& reader, const platform::Bundle& bundle,
                                           const std::set<std::string>& filterKeys) {
  std::optional<Value> filtered = reader.filteredInfoPlist(bundle, filterKeys);
  if (!filtered) {
    QS_SYSLOG(kQSLogLevelError, kLoadInfoPlistFunction, "Failed to get filtered Info.plist with keys %@ from bundle %@",
              describableKeys(filterKeys), bundle);
    return std::nullopt;
  }
  Dictionary* dictionary = filtered->asDictionary();
  if (!dictionary) {
    QS_SYSLOG(kQSLogLevelError, kLoadInfoPlistFunction,
              "Object returned from _RkBundleCreateFilteredInfoPlist was not a dictionary, was type %@",
              std::string(filtered->typeName()));
    return std::nullopt;
  }
  return std::move(*dictionary);
}

}  // namespace

std::optional<Dictionary> QSLoadInfoPlist(const URL& bundleURL, const std::set<std::string>* filterKeys) {
  return QSLoadInfoPlist(bundleURL, filterKeys, processBundleReader());
}

std::optional<Dictionary> QSLoadInfoPlist(const URL& bundleURL, const std::set<std::string>* filterKeys,
                                          platform::BundleReader& reader) {
  URL infoPlistURL = bundleURL.appending(platform::kInfoPlistFileName, false);
  if (QSFileManager::defaultManager().itemDoesNotExistAtURL(infoPlistURL)) {
    QS_SYSLOG(kQSLogLevelDebug, kLoadInfoPlistFunction, "Missing Info.plist at %@", infoPlistURL);
    return std::nullopt;
  }

  std::lock_guard<std::mutex> lock(bundleReadLock());
  // A fresh bundle object every time: nothing read earlier for this location is reused.
  std::shared_ptr<platform::Bundle> bundle = reader.openBundle(bundleURL);
  if (!bundle) {
    QS_SYSLOG(kQSLogLevelError, kLoadInfoPlistFunction, "Failed to create RkBundle from URL %@", bundleURL);
    return std::nullopt;
  }
  if (!filterKeys) return readWholeInfo(reader, *bundle, bundleURL);
  return readFilteredInfo(reader, *bundle, *filterKeys);
}
