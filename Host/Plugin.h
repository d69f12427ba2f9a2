// Loading the migration plug-in.
#pragma once

#include <optional>
#include <string>

#include "Platform/Host/DataClassMigrator.h"
#include "Platform/Host/MigrationPlan.h"

namespace transvale {

// The plug-in's entry point, resolved. The plug-in stays loaded for the rest
// of the process: what it creates lives as long.
struct LoadedPlugin {
  std::string path;
  QSCreateDataClassMigratorFunction create = nullptr;
  // The dry run and the observer setter; null when the plug-in has none.
  QSPlanDataClassMigrationFunction plan = nullptr;
  QSSetMigrationObserverFunction setObserver = nullptr;
};

// Loads the plug-in at `path` and resolves its entry point; none with a
// message in *error when either fails.
std::optional<LoadedPlugin> loadPlugin(const std::string& path, std::string* error);

// The plug-in beside this program: <dir of the executable>/../lib/QSAppMigrator.so
// in a build tree, else the installed <dir>/../<libdir>/quillset/QSAppMigrator.so
// when it exists.
std::string defaultPluginPath();

}  // namespace transvale
