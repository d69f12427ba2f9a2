// The installation daemon's client calls used by the migrator.
//
// InstallationDaemonClient is an interface so that unit tests use fakes; the
// real one is SQLiteApplicationRegistry's (SQLiteRegistry.h).
#pragma once

#include <string>

#include "Platform/Foundation/Value.h"

namespace platform {

// Option of the data-protection update: also update the data containers of
// system applications.
inline constexpr char kQSUpdateSystemAppDataContainerDataProtection[] = "UpdateSystemAppDataContainerDataProtection";

class InstallationDaemonClient {
 public:
  virtual ~InstallationDaemonClient() = default;
  // Registers `path` as the safe harbor of `identifier`. Refused (false) when
  // the path is not an existing directory. `containerType` is 2 for the
  // migrator; `options` may be null.
  virtual bool QuillsetRegisterSafeHarborForContainerType(const std::string& path, const std::string& identifier,
                                                          int containerType, const Value* options) = 0;
  // Brings the data protection of the containers up to date.
  [[nodiscard]] virtual bool QuillsetUpdateContainerDataProtectionForMigratorOnly(const Dictionary& options) = 0;
};

}  // namespace platform
