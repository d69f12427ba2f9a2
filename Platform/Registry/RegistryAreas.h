// Where the registry may act. Every path it takes from its database (journal
// rows, recorded containers) is checked here before a file is made, moved or
// removed: a row that points anywhere else was not written by the registry
// (a damaged or planted database) and is refused with an error naming it, and
// left as it is for a person to look at.
//
// Thread safety: pure functions of the file system's state.
#pragma once

#include <string>

#include "Platform/Foundation/Error.h"
#include "Platform/Registry/RegistryState.h"
#include "Platform/Registry/RegistryTables.h"

namespace platform::registry {

// Whether `path` lies strictly inside `area`, one of the layout's directories
// (resolved once for the layout's life: the registry alone makes them).
bool liesInArea(const RegistryLayout& layout, const std::string& path, const std::string& area);

// A container the registry made: strictly inside `area` (one of the layout's
// container directories). Otherwise false with kRegistryErrorOutsideAreas
// naming `what` and the path.
bool checkContainerPath(const RegistryLayout& layout, const std::string& path, const std::string& area,
                        const char* what, Error* error);

// A package the registry may install from (and so journal moves out of and
// remove): inside the system root, outside the database directory, the
// built-in applications and the containers. Otherwise false with
// kRegistryErrorOutsideAreas.
bool checkPackagePath(const RegistryLayout& layout, const std::string& package, Error* error);

// A journal row the registry could have written: creations and removals of
// containers inside its container directories, moves into its bundle
// containers from a place inside the system root, removals of a package
// directory (one holding "Payload") inside the system root.
bool checkJournalEntry(const RegistryLayout& layout, const JournalEntry& entry, Error* error);

}  // namespace platform::registry
