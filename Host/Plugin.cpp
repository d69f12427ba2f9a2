#include "Host/Plugin.h"

#include <dlfcn.h>

#include <filesystem>
#include <system_error>

namespace transvale {

namespace {
constexpr char kOwnExecutableLink[] = "/proc/self/exe";
constexpr char kPluginPathFromExecutableDirectory[] = "../lib/QSAppMigrator.so";
// Where an installation puts it, relative to the installed executable.
#ifndef QS_INSTALLED_PLUGIN_FROM_BINDIR
#define QS_INSTALLED_PLUGIN_FROM_BINDIR "../lib/quillset/QSAppMigrator.so"
#endif
constexpr char kInstalledPluginFromExecutableDirectory[] = QS_INSTALLED_PLUGIN_FROM_BINDIR;
}  // namespace

std::optional<LoadedPlugin> loadPlugin(const std::string& path, std::string* error) {
  // Never closed: the migrator and the services the plug-in leaks use its code.
  void* handle = dlopen(path.c_str(), RTLD_NOW | RTLD_LOCAL);
  if (!handle) {
    *error = "cannot load the plug-in " + path + ": " + dlerror();
    return std::nullopt;
  }
  dlerror();
  void* symbol = dlsym(handle, kDataClassMigratorEntryPoint);
  if (!symbol) {
    const char* reason = dlerror();
    *error = "the plug-in " + path + " has no entry point " + kDataClassMigratorEntryPoint + ": " +
             (reason ? reason : "null symbol");
    dlclose(handle);
    return std::nullopt;
  }
  LoadedPlugin plugin{path, reinterpret_cast<QSCreateDataClassMigratorFunction>(symbol)};
  plugin.plan = reinterpret_cast<QSPlanDataClassMigrationFunction>(dlsym(handle, kMigrationPlanEntryPoint));
  plugin.setObserver = reinterpret_cast<QSSetMigrationObserverFunction>(dlsym(handle, kMigrationObserverEntryPoint));
  dlerror();
  return plugin;
}

std::string defaultPluginPath() {
  std::error_code ec;
  const std::filesystem::path executable = std::filesystem::read_symlink(kOwnExecutableLink, ec);
  const std::filesystem::path directory = ec ? std::filesystem::current_path(ec) : executable.parent_path();
  const std::filesystem::path built = (directory / kPluginPathFromExecutableDirectory).lexically_normal();
  const std::filesystem::path installed = (directory / kInstalledPluginFromExecutableDirectory).lexically_normal();
  if (!std::filesystem::exists(built, ec) && std::filesystem::exists(installed, ec)) return installed.string();
  return built.string();
}

}  // namespace transvale
