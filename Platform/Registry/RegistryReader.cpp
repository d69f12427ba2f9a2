#include "Platform/Registry/RegistryReader.h"

#include <sys/stat.h>

#include <algorithm>

#include "Platform/Foundation/Format.h"
#include "Platform/Registry/RegistryFiles.h"
#include "Platform/Registry/RegistryTables.h"
#include "Platform/SystemLog.h"

namespace platform {

using namespace registry;

namespace {

constexpr char kReaderFunction[] = "RegistryReader";
constexpr int kFailureLevel = 3;

URL directoryURL(const std::string& path) {
  return URL::fileURL(path, true);
}

void logFailure(const char* what, const std::string& subject, const Error& error) {
  SystemLogWrite(nullptr, kFailureLevel, kReaderFunction, "%s %s: %@", what, subject, error);
}

Error readOnlyRefusal(const URL& url) {
  return Error(kRegistryErrorDomain, kRegistryErrorReadOnly,
               Dictionary{{kLocalizedDescriptionKey,
                           Value(Format("The registry is open for reading only; %s is not installed", url.path()))}});
}

}  // namespace

namespace registry {

BundleRecord bundleRecordFromStored(const StoredRecord& stored) {
  BundleRecord record;
  record.identifier = stored.identifier;
  record.bundleType = stored.bundleType;
  record.bundleURL = directoryURL(stored.bundlePath);
  record.bundleContainerURL = directoryURL(stored.bundleContainer);
  if (stored.dataContainer) record.dataContainerURL = directoryURL(*stored.dataContainer);
  if (stored.hasGroupDictionary) {
    record.groupContainerURLs.emplace();
    for (const auto& [group, path] : stored.groups) (*record.groupContainerURLs)[group] = directoryURL(path);
  }
  record.foundBackingBundle = isDirectory(stored.bundlePath);
  record.isPlaceholder = stored.isPlaceholder;
  record.version = stored.version;
  record.displayName = stored.displayName;
  return record;
}

BundleRecord builtInRecordWithoutContainers(const BuiltInApplication& application) {
  BundleRecord record;
  record.identifier = application.info.identifier;
  record.bundleType = kBundleTypeSystem;
  record.bundleURL = directoryURL(application.bundlePath);
  record.bundleContainerURL = record.bundleURL.deletingLastPathComponent();
  record.foundBackingBundle = true;
  record.version = application.info.version;
  record.displayName = application.info.displayName;
  return record;
}

}  // namespace registry

RegistryReader::RegistryReader(RegistryLayout layout, std::unique_ptr<Database> db)
    : layout_(std::move(layout)), db_(std::move(db)), builtIns_(layout_.systemApplications) {}

std::unique_ptr<RegistryReader> RegistryReader::open(const std::string& systemRoot, bool allowMissingDatabase,
                                                     Error* error) {
  RegistryLayout layout(systemRoot);
  struct stat status;
  std::unique_ptr<Database> db;
  if (::stat(layout.databasePath.c_str(), &status) != 0) {
    if (!allowMissingDatabase) {
      if (error) {
        *error = Error(kRegistryErrorDomain, kRegistryErrorNoDatabase,
                       Dictionary{{kLocalizedDescriptionKey,
                                   Value(Format("There is no registry database at %s", layout.databasePath))}});
      }
      return nullptr;
    }
  } else {
    db = Database::openReadOnly(layout.databasePath, error);
    if (!db) return nullptr;
  }
  return std::unique_ptr<RegistryReader>(new RegistryReader(std::move(layout), std::move(db)));
}

bool RegistryReader::isInstalled(const std::string& identifier) {
  return recordForIdentifier(identifier).has_value();
}

std::optional<BundleRecord> RegistryReader::recordForIdentifier(const std::string& identifier) {
  std::optional<StoredRecord> stored;
  if (db_) {
    Error error;
    std::lock_guard lock(dbMutex_);
    if (!loadRecord(*db_, identifier, &stored, &error)) {
      logFailure("Could not look up", identifier, error);
      return std::nullopt;
    }
  }
  if (stored) return bundleRecordFromStored(*stored);
  std::optional<BuiltInApplication> builtIn = builtIns_.find(identifier);
  if (!builtIn) return std::nullopt;
  return builtInRecord(*builtIn);
}

std::optional<BundleRecord> RegistryReader::builtInRecord(const BuiltInApplication& application) {
  BundleRecord record = registry::builtInRecordWithoutContainers(application);
  if (!application.info.noDataContainer) {
    std::optional<std::string> data;
    if (db_) {
      Error error;
      std::lock_guard lock(dbMutex_);
      if (!loadSystemDataContainer(*db_, record.identifier, &data, &error)) {
        logFailure("Could not look up the data container of", record.identifier, error);
        return std::nullopt;
      }
    }
    if (data) {
      record.dataContainerURL = directoryURL(*data);
    } else {
      record.dataContainerToBeMade = true;
    }
  }
  record.groupContainerURLs.emplace();
  for (const std::string& group : application.info.groups) {
    (*record.groupContainerURLs)[group] = groupContainerForGroup(group).value_or(newGroupContainerDirectory());
  }
  return record;
}

bool RegistryReader::installPackage(const URL& package, const Dictionary&, const InstallProgressCallback&,
                                    Error* error) {
  if (error) *error = readOnlyRefusal(package);
  return false;
}

bool RegistryReader::installBundle(const URL& bundle, const Dictionary&, Error* error) {
  if (error) *error = readOnlyRefusal(bundle);
  return false;
}

URL RegistryReader::newDataContainerDirectory(bool vpnPlugin) {
  return directoryURL(vpnPlugin ? layout_.pluginDataContainers : layout_.applicationDataContainers);
}

URL RegistryReader::newGroupContainerDirectory() {
  return directoryURL(layout_.groupContainers);
}

std::optional<URL> RegistryReader::groupContainerForGroup(const std::string& group) {
  if (!db_) return std::nullopt;
  std::optional<std::string> path;
  Error error;
  std::lock_guard lock(dbMutex_);
  if (!loadGroupContainer(*db_, group, &path, &error)) {
    logFailure("Could not look up the container of group", group, error);
    return std::nullopt;
  }
  if (!path) return std::nullopt;
  return directoryURL(*path);
}

bool RegistryReader::refusesAsNotNewerThanBuiltIn(const std::string& identifier, const std::string& version) {
  std::optional<BuiltInApplication> builtIn = builtIns_.find(identifier);
  return builtIn && builtInSupersedes(builtIn->info.version, version);
}

std::vector<BundleRecord> RegistryReader::allRecords() {
  std::vector<StoredRecord> stored;
  if (db_) {
    Error error;
    std::lock_guard lock(dbMutex_);
    if (!loadAllRecords(*db_, &stored, &error)) logFailure("Could not list", "records", error);
  }
  std::vector<BundleRecord> records;
  for (const StoredRecord& record : stored) records.push_back(bundleRecordFromStored(record));
  for (const BuiltInApplication& application : builtIns_.all()) {
    const bool shadowed = std::any_of(stored.begin(), stored.end(), [&](const StoredRecord& r) {
      return r.identifier == application.info.identifier;
    });
    if (shadowed) continue;
    if (std::optional<BundleRecord> record = builtInRecord(application)) records.push_back(std::move(*record));
  }
  std::sort(records.begin(), records.end(),
            [](const BundleRecord& a, const BundleRecord& b) { return a.identifier < b.identifier; });
  return records;
}

std::vector<SafeHarborRecord> RegistryReader::safeHarbors() {
  std::vector<SafeHarborRecord> harbors;
  if (!db_) return harbors;
  Error error;
  std::lock_guard lock(dbMutex_);
  if (!loadSafeHarbors(*db_, &harbors, &error)) logFailure("Could not list", "safe harbors", error);
  return harbors;
}

}  // namespace platform
