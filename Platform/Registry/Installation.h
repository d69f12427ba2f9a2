// Installations: a package directory (installPackage) or a single bundle
// directory (installBundle, placeholders included) becomes a record with its
// containers.
//
// An installation is journalled: the file actions it is about to take are
// recorded (one transaction), taken, and the records committed together with
// the journal's replacement by the removals still to do (a second
// transaction); then the replaced bundle container and the package directory
// are removed and the journal emptied. A failure before the commit undoes the
// file actions; a crash is undone when the registry is next opened.
//
// Thread safety: each function takes the state's change lock and the install
// lock file for its whole duration.
#pragma once

#include "Platform/Registry/ApplicationRegistry.h"
#include "Platform/Registry/RegistryState.h"

namespace platform::registry {

// Installs a package directory, calling `progress` (may be empty) on the
// calling thread with each report, the failure report included.
[[nodiscard]] bool installPackageDirectory(RegistryState& state, const URL& package, const Dictionary& options,
                             const InstallProgressCallback& progress, Error* error);

// Installs a copy of the bundle directory at `bundle` (left in place): a
// placeholder when the options' package type is kRegistryPackageTypePlaceholder,
// else an ordinary application.
[[nodiscard]] bool installBundleDirectory(RegistryState& state, const URL& bundle, const Dictionary& options, Error* error);

}  // namespace platform::registry
