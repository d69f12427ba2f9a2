// The system-version dictionary of the running release:
// <root>/System/Library/CoreServices/SystemVersion.plist.
#pragma once

#include <optional>
#include <string>

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

class FileSystemVersionSource final : public SystemVersionSource {
 public:
  explicit FileSystemVersionSource(std::string systemRoot) : systemRoot_(std::move(systemRoot)) {}
  std::optional<Dictionary> systemVersionDictionary() override;
  std::string path() const;

 private:
  std::string systemRoot_;
};

}  // namespace platform
