#include "Platform/SystemVersion.h"

#include "Platform/Foundation/PropertyList.h"
#include "Platform/Preferences.h"

namespace platform {

namespace {

constexpr char kSystemVersionFile[] = "System/Library/CoreServices/SystemVersion.plist";

}  // namespace

FileSystemVersionSource::FileSystemVersionSource(std::string systemRoot)
    : systemRoot_(normalizedSystemRoot(systemRoot)) {}

std::string FileSystemVersionSource::path() const { return systemRoot_ + "/" + kSystemVersionFile; }

std::optional<Dictionary> FileSystemVersionSource::readSystemVersionDictionary(Error* error) const {
  return plist::readDictionary(URL::fileURL(path()), error);
}

std::optional<Dictionary> FileSystemVersionSource::systemVersionDictionary() {
  return readSystemVersionDictionary(nullptr);
}

}  // namespace platform
