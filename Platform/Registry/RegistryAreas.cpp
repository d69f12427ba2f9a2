#include "Platform/Registry/RegistryAreas.h"

#include "Platform/Foundation/FileErrors.h"
#include "Platform/Foundation/Format.h"
#include "Platform/Foundation/PathContainment.h"
#include "Platform/Registry/RegistryFiles.h"
#include "Platform/Registry/SQLiteRegistry.h"

namespace platform::registry {

namespace {

constexpr char kPayloadDirectoryName[] = "Payload";

const char* kindName(JournalKind kind) {
  switch (kind) {
    case JournalKind::Create:
      return "creation";
    case JournalKind::Move:
      return "move";
    case JournalKind::Remove:
      return "removal";
  }
  return "entry";
}

Error outside(const std::string& message) {
  return registryError(kRegistryErrorOutsideAreas, message + "; refused and left for a person");
}

bool insideAny(const RegistryLayout& layout, const std::string& path, std::initializer_list<const std::string*> areas) {
  const std::optional<std::string> resolved = path::resolvedAsFarAsExists(path);
  for (const std::string* area : areas) {
    if (path::placementOfResolved(resolved, (*layout.resolved)(*area)) == path::Placement::Inside) return true;
  }
  return false;
}

// A directory the caller handed in as a package: inside the root, outside the
// registry's own places, holding a "Payload" directory.
bool isPackageDirectory(const RegistryLayout& layout, const std::string& path) {
  return liesInArea(layout, path, layout.systemRoot) &&
         !insideAny(layout, path, {&layout.databaseDirectory, &layout.systemApplications}) &&
         isDirectoryNoFollow(path) && isDirectoryNoFollow(path::join(path, kPayloadDirectoryName));
}

}  // namespace

bool liesInArea(const RegistryLayout& layout, const std::string& path, const std::string& area) {
  return layout.resolved->holdsInside(path, area);
}

bool checkContainerPath(const RegistryLayout& layout, const std::string& path, const std::string& area,
                        const char* what, Error* error) {
  if (liesInArea(layout, path, area)) return true;
  return failWith(error, outside(Format("The recorded %s %s does not lie inside %s", what, path, area)));
}

bool checkPackagePath(const RegistryLayout& layout, const std::string& package, Error* error) {
  if (liesInArea(layout, package, layout.systemRoot) &&
      !insideAny(layout, package,
                 {&layout.databaseDirectory, &layout.systemApplications, &layout.bundleContainers,
                  &layout.applicationDataContainers, &layout.pluginDataContainers, &layout.groupContainers})) {
    return true;
  }
  return failWith(error, outside(Format("The package %s does not lie in the system root %s, outside the registry's "
                                        "own directories",
                                        package, layout.systemRoot)));
}

bool checkJournalEntry(const RegistryLayout& layout, const JournalEntry& entry, Error* error) {
  auto inContainerArea = [&](const std::string& path) {
    return insideAny(layout, path,
                     {&layout.bundleContainers, &layout.applicationDataContainers, &layout.pluginDataContainers,
                      &layout.groupContainers});
  };
  bool fine = false;
  switch (entry.kind) {
    case JournalKind::Create:
      fine = inContainerArea(entry.destination);
      break;
    case JournalKind::Move:
      fine = liesInArea(layout, entry.destination, layout.bundleContainers) &&
             liesInArea(layout, entry.source, layout.systemRoot) &&
             !insideAny(layout, entry.source, {&layout.databaseDirectory, &layout.systemApplications});
      break;
    case JournalKind::Remove:
      fine = inContainerArea(entry.destination) || isPackageDirectory(layout, entry.destination);
      break;
  }
  if (fine) return true;
  return failWith(error, outside(Format("The installation journal's %s of %s (from %s) lies outside the registry's "
                                        "areas",
                                        kindName(entry.kind), entry.destination, entry.source)));
}

}  // namespace platform::registry
