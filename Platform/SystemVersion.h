// The system-version dictionary of the running release:
// <root>/System/Library/CoreServices/SystemVersion.plist.
#pragma once

#include <optional>
#include <string>

#include "Platform/Foundation/Error.h"
#include "Platform/Foundation/Value.h"

namespace platform {

inline constexpr char kSystemVersionBuildVersionKey[] = "BuildVersion";
inline constexpr char kSystemVersionProductVersionKey[] = "ProductVersion";
inline constexpr char kSystemVersionProductNameKey[] = "ProductName";

class SystemVersionSource {
 public:
  virtual ~SystemVersionSource() = default;
  // The dictionary, or none when it cannot be read.
  virtual std::optional<Dictionary> systemVersionDictionary() = 0;
};

// Reads the file afresh on every call; thread-safe. `systemRoot` is "" or "/"
// for the real root.
class FileSystemVersionSource final : public SystemVersionSource {
 public:
  explicit FileSystemVersionSource(std::string systemRoot);
  std::optional<Dictionary> systemVersionDictionary() override;
  // The same, with the reason in *error (kFileErrorDomain, as
  // plist::readDictionary reports it) when the file is missing, unreadable or
  // its root is not a dictionary.
  std::optional<Dictionary> readSystemVersionDictionary(Error* error) const;
  std::string path() const;

 private:
  std::string systemRoot_;
};

}  // namespace platform
