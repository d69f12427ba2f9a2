// DataClassMigrator: the data-migration host's base class of a migration
// plug-in, and the plug-in's entry point.
//
// The host calls dataClassName, estimatedDuration and performMigration on
// one thread; migrationProgress may be called from another thread while
// performMigration runs, so implementations make it safe to do so.
#pragma once

#include <string>

namespace platform {

class DataClassMigrator {
 public:
  virtual ~DataClassMigrator() = default;
  virtual std::string dataClassName() = 0;
  virtual float estimatedDuration() = 0;
  virtual float migrationProgress() = 0;
  [[nodiscard]] virtual bool performMigration() = 0;
};

}  // namespace platform

// The plug-in exports one C entry point of this name and type. It creates the
// migrator with the real platform services; null when creation yields
// nothing. The caller owns the result and deletes it.
inline constexpr char kDataClassMigratorEntryPoint[] = "QSCreateDataClassMigrator";
extern "C" {
typedef platform::DataClassMigrator* (*QSCreateDataClassMigratorFunction)(void);
}
