#include "Host/Plugin.h"

#include <dlfcn.h>

#include <filesystem>
#include <system_error>

namespace transvale {

namespace {
constexpr char kOwnExecutableLink[] = "/proc/self/exe";
constexpr char kPluginPathFromExecutableDirectory[] = "../lib/QSAppMigrator.so";
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
  return LoadedPlugin{path, reinterpret_cast<QSCreateDataClassMigratorFunction>(symbol)};
}

std::string defaultPluginPath() {
  std::error_code ec;
  const std::filesystem::path executable = std::filesystem::read_symlink(kOwnExecutableLink, ec);
  const std::filesystem::path directory = ec ? std::filesystem::current_path(ec) : executable.parent_path();
  return (directory / kPluginPathFromExecutableDirectory).lexically_normal().string();
}

}  // namespace transvale
