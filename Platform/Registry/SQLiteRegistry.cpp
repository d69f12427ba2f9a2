#include "Platform/Registry/SQLiteRegistry.h"

#include <algorithm>
#include <condition_variable>
#include <functional>
#include <mutex>
#include <system_error>
#include <thread>

#include "Platform/Foundation/Format.h"
#include "Platform/Registry/Installation.h"
#include "Platform/Registry/RegistryAreas.h"
#include "Platform/Registry/RegistryFiles.h"
#include "Platform/Registry/RegistryReader.h"
#include "Platform/Registry/RegistryState.h"
#include "Platform/Registry/RegistryTables.h"
#include "Platform/SystemLog.h"

namespace platform {

using namespace registry;

namespace {

constexpr char kOpenFunction[] = "SQLiteApplicationRegistry::open";
constexpr char kLookupFunction[] = "SQLiteApplicationRegistry::recordForIdentifier";
constexpr char kInstallPackageFunction[] = "SQLiteApplicationRegistry::installPackage";
constexpr char kSafeHarborFunction[] = "QuillsetRegisterSafeHarborForContainerType";
constexpr char kDataProtectionFunction[] = "QuillsetUpdateContainerDataProtectionForMigratorOnly";
constexpr int kFailureLevel = 3;

URL directoryURL(const std::string& path) {
  return URL::fileURL(path, true);
}

// The container recorded for `key` by `load`, made (and recorded through
// `save`) on first use. Another process may record one first: then its
// container is the one, and ours goes.
template <class Load, class Save>
std::optional<std::string> ensureContainer(RegistryState& state, const std::string& parent, Load load, Save save,
                                           Error* error) {
  std::optional<std::string> recorded;
  {
    std::lock_guard dbLock(state.dbMutex);
    if (!load(*state.db, &recorded, error)) return std::nullopt;
  }
  if (recorded) {
    if (!checkContainerPath(state.layout, *recorded, parent, "container", error) || !makeDirectories(*recorded, error)) {
      return std::nullopt;
    }
    return recorded;
  }
  std::optional<std::string> made = newContainerPath(parent, error);
  if (!made || !createNewDirectory(*made, error)) return std::nullopt;
  std::string winner;
  bool saved = false;
  {
    std::lock_guard dbLock(state.dbMutex);
    auto transaction = Transaction::begin(*state.db, error);
    saved = transaction && save(*state.db, *made, &winner, error) && transaction->commit(error);
  }
  if (!saved || winner != *made) (void)removeTree(*made, nullptr);  // an empty directory nobody records
  if (!saved) return std::nullopt;
  return winner;
}

std::optional<std::string> ensureSystemDataContainer(RegistryState& state, const std::string& identifier,
                                                     Error* error) {
  return ensureContainer(
      state, state.layout.applicationDataContainers,
      [&](Database& db, std::optional<std::string>* out, Error* e) {
        return loadSystemDataContainer(db, identifier, out, e);
      },
      [&](Database& db, const std::string& path, std::string* winner, Error* e) {
        return saveSystemDataContainer(db, identifier, path, winner, e);
      },
      error);
}

std::optional<std::string> ensureGroupContainer(RegistryState& state, const std::string& group, Error* error) {
  return ensureContainer(
      state, state.layout.groupContainers,
      [&](Database& db, std::optional<std::string>* out, Error* e) { return loadGroupContainer(db, group, out, e); },
      [&](Database& db, const std::string& path, std::string* winner, Error* e) {
        std::optional<std::string> recorded;
        if (!saveGroupContainer(db, group, path, e) || !loadGroupContainer(db, group, &recorded, e)) return false;
        *winner = recorded.value_or(path);
        return true;
      },
      error);
}

// The record of a built-in application; its data and group containers are
// made on first lookup.
std::optional<BundleRecord> systemRecord(RegistryState& state, const BuiltInApplication& application, Error* error) {
  BundleRecord record = builtInRecordWithoutContainers(application);
  if (!application.info.noDataContainer) {
    std::optional<std::string> data = ensureSystemDataContainer(state, record.identifier, error);
    if (!data) return std::nullopt;
    record.dataContainerURL = directoryURL(*data);
  }
  record.groupContainerURLs.emplace();
  for (const std::string& group : application.info.groups) {
    std::optional<std::string> path = ensureGroupContainer(state, group, error);
    if (!path) return std::nullopt;
    (*record.groupContainerURLs)[group] = directoryURL(*path);
  }
  return record;
}

void logFailure(const char* function, const char* what, const std::string& subject, const Error& error) {
  SystemLogWrite(nullptr, kFailureLevel, function, "%s %s: %@", what, subject, error);
}

}  // namespace

// The thread that runs installations and delivers their progress reports:
// started with the first installation and kept until the registry goes away,
// so that an installation does not pay for starting a thread and for handing
// its stack back when it ends. Callers take turns.
class InstallWorker {
 public:
  ~InstallWorker() {
    {
      std::lock_guard lock(mutex_);
      stopping_ = true;
    }
    wake_.notify_all();
    if (thread_.joinable()) thread_.join();
  }

  // Runs `job` on the worker and returns once it has ended. Throws
  // std::system_error when the thread cannot be started.
  void run(const std::function<void()>& job) {
    std::lock_guard turn(turnMutex_);
    std::unique_lock lock(mutex_);
    if (!thread_.joinable()) thread_ = std::thread([this] { serve(); });
    job_ = &job;
    wake_.notify_all();
    wake_.wait(lock, [this] { return job_ == nullptr; });
  }

 private:
  void serve() {
    std::unique_lock lock(mutex_);
    for (;;) {
      wake_.wait(lock, [this] { return stopping_ || job_ != nullptr; });
      if (!job_) return;  // stopping, with nothing left to run
      lock.unlock();
      (*job_)();
      lock.lock();
      job_ = nullptr;
      wake_.notify_all();
    }
  }

  std::mutex turnMutex_;  // one caller at a time
  std::mutex mutex_;
  std::condition_variable wake_;
  const std::function<void()>* job_ = nullptr;  // guarded by mutex_
  bool stopping_ = false;                       // guarded by mutex_
  std::thread thread_;
};

struct SQLiteApplicationRegistry::Impl : RegistryState {
  using RegistryState::RegistryState;
  InstallWorker installWorker;
};

std::unique_ptr<SQLiteApplicationRegistry> SQLiteApplicationRegistry::open(const std::string& systemRoot,
                                                                           Error* error) {
  RegistryLayout layout(systemRoot);
  Error failure;
  if (!makeDirectories(layout.databaseDirectory, &failure)) {
    if (error) *error = Error(kRegistryErrorDomain, kRegistryErrorDatabase, failure.userInfo());
    return nullptr;
  }
  std::unique_ptr<Database> db = Database::open(layout.databasePath, error);
  if (!db) return nullptr;
  auto impl = std::make_unique<Impl>(std::move(layout), std::move(db));
  {
    std::lock_guard changeLock(impl->changeMutex);
    std::optional<FileLock> fileLock = FileLock::acquire(impl->layout.lockPath, &failure);
    if (!fileLock) {
      if (error) *error = Error(kRegistryErrorDomain, kRegistryErrorDatabase, failure.userInfo());
      return nullptr;
    }
    // What cannot be undone now stays journalled; every installation tries
    // again first and refuses to start over it.
    (void)recoverJournalLocked(*impl, kOpenFunction, nullptr);
  }
  return std::unique_ptr<SQLiteApplicationRegistry>(new SQLiteApplicationRegistry(std::move(impl)));
}

SQLiteApplicationRegistry::SQLiteApplicationRegistry(std::unique_ptr<Impl> impl) : impl_(std::move(impl)) {}
SQLiteApplicationRegistry::~SQLiteApplicationRegistry() = default;

bool SQLiteApplicationRegistry::isInstalled(const std::string& identifier) {
  std::optional<StoredRecord> record;
  Error error;
  {
    std::lock_guard dbLock(impl_->dbMutex);
    if (!loadRecord(*impl_->db, identifier, &record, &error)) {
      logFailure(kLookupFunction, "Could not look up", identifier, error);
      return false;
    }
  }
  return record.has_value() || impl_->builtIns.find(identifier).has_value();
}

std::optional<BundleRecord> SQLiteApplicationRegistry::recordForIdentifier(const std::string& identifier) {
  std::optional<StoredRecord> stored;
  Error error;
  {
    std::lock_guard dbLock(impl_->dbMutex);
    if (!loadRecord(*impl_->db, identifier, &stored, &error)) {
      logFailure(kLookupFunction, "Could not look up", identifier, error);
      return std::nullopt;
    }
  }
  if (stored) return bundleRecordFromStored(*stored);
  std::optional<BuiltInApplication> builtIn = impl_->builtIns.find(identifier);
  if (!builtIn) return std::nullopt;
  std::optional<BundleRecord> record = systemRecord(*impl_, *builtIn, &error);
  if (!record) logFailure(kLookupFunction, "Could not make the containers of built-in application", identifier, error);
  return record;
}

bool SQLiteApplicationRegistry::installPackage(const URL& package, const Dictionary& options,
                                               const InstallProgressCallback& progress, Error* error) {
  // The installation runs on the registry's worker thread, which delivers
  // every report; once run() returns, the last report has been delivered.
  bool installed = false;
  Error failure;
  try {
    impl_->installWorker.run([&] { installed = installPackageDirectory(*impl_, package, options, progress, &failure); });
  } catch (const std::system_error& e) {
    failure = registryError(kRegistryErrorFileOperation,
                            Format("Could not start the installation of %s: %s", package.path(), e.what()));
    logFailure(kInstallPackageFunction, "Could not install", package.path(), failure);
  }
  if (!installed && error) *error = failure;
  return installed;
}

bool SQLiteApplicationRegistry::installBundle(const URL& bundle, const Dictionary& options, Error* error) {
  return installBundleDirectory(*impl_, bundle, options, error);
}

bool SQLiteApplicationRegistry::QuillsetRegisterSafeHarborForContainerType(const std::string& path,
                                                                           const std::string& identifier,
                                                                           int containerType, const Value* options) {
  (void)options;  // no option changes how a safe harbor is registered
  if (!isDirectory(path)) {
    SystemLogWrite(nullptr, kFailureLevel, kSafeHarborFunction, "Safe harbor %s of %s is not an existing directory",
                   path, identifier);
    return false;
  }
  Error error;
  std::lock_guard dbLock(impl_->dbMutex);
  auto transaction = Transaction::begin(*impl_->db, &error);
  if (transaction && saveSafeHarbor(*impl_->db, {identifier, path, containerType}, &error) &&
      transaction->commit(&error)) {
    return true;
  }
  logFailure(kSafeHarborFunction, "Could not register safe harbor of", identifier, error);
  return false;
}

bool SQLiteApplicationRegistry::QuillsetUpdateContainerDataProtectionForMigratorOnly(const Dictionary& options) {
  auto update = options.find(kQSUpdateSystemAppDataContainerDataProtection);
  if (update == options.end() || !update->second.boolValue(false)) return true;
  bool ok = true;
  for (const BuiltInApplication& application : impl_->builtIns.all()) {
    if (application.info.noDataContainer) continue;
    Error error;
    std::optional<std::string> data = ensureSystemDataContainer(*impl_, application.info.identifier, &error);
    if (!data || !setProtectionClass(*data, kSystemDataContainerProtectionClass, &error)) {
      logFailure(kDataProtectionFunction, "Could not update the data protection of", application.info.identifier,
                 error);
      ok = false;
    }
  }
  return ok;
}

std::vector<BundleRecord> SQLiteApplicationRegistry::allRecords() {
  std::vector<StoredRecord> stored;
  Error error;
  {
    std::lock_guard dbLock(impl_->dbMutex);
    if (!loadAllRecords(*impl_->db, &stored, &error)) logFailure(kLookupFunction, "Could not list", "records", error);
  }
  std::vector<BundleRecord> records;
  for (const StoredRecord& record : stored) records.push_back(bundleRecordFromStored(record));
  for (const BuiltInApplication& application : impl_->builtIns.all()) {
    bool shadowed = std::any_of(stored.begin(), stored.end(),
                                [&](const StoredRecord& r) { return r.identifier == application.info.identifier; });
    if (shadowed) continue;
    std::optional<BundleRecord> record = systemRecord(*impl_, application, &error);
    if (record) {
      records.push_back(std::move(*record));
    } else {
      logFailure(kLookupFunction, "Could not make the containers of built-in application", application.info.identifier,
                 error);
    }
  }
  std::sort(records.begin(), records.end(),
            [](const BundleRecord& a, const BundleRecord& b) { return a.identifier < b.identifier; });
  return records;
}

std::vector<SafeHarborRecord> SQLiteApplicationRegistry::safeHarbors() {
  std::vector<SafeHarborRecord> harbors;
  Error error;
  std::lock_guard dbLock(impl_->dbMutex);
  if (!loadSafeHarbors(*impl_->db, &harbors, &error))
    logFailure(kLookupFunction, "Could not list", "safe harbors", error);
  return harbors;
}

}  // namespace platform
