#include "Platform/Registry/Installation.h"

#include <set>

#include "Platform/BundleReader.h"
#include "Platform/Foundation/Format.h"
#include "Platform/Foundation/PathContainment.h"
#include "Platform/Registry/BundleInfo.h"
#include "Platform/Registry/RegistryAreas.h"
#include "Platform/Registry/RegistryFiles.h"
#include "Platform/Registry/SQLiteRegistry.h"
#include "Platform/SystemLog.h"

namespace platform::registry {

namespace {

constexpr char kInstallPackageFunction[] = "SQLiteApplicationRegistry::installPackage";
constexpr char kInstallBundleFunction[] = "SQLiteApplicationRegistry::installBundle";

constexpr char kPayloadDirectoryName[] = "Payload";
// A placeholder's store metadata, kept beside its bundle.

constexpr int kPercentVerifying = 5;
constexpr int kPercentStaging = 30;
constexpr int kPercentRegistering = 70;
constexpr int kPercentCleaningUp = 90;
constexpr int kPercentComplete = 100;
constexpr int kFailureLevel = 3;

// The "Error" names of failure reports, one per error code.
const char* errorName(int64_t code) {
  switch (code) {
    case kRegistryErrorDatabase:
      return "DatabaseError";
    case kRegistryErrorInvalidPackage:
      return "InvalidPackage";
    case kRegistryErrorInvalidInfoPlist:
      return "InvalidInfoPlist";
    case kRegistryErrorIdentifierMismatch:
      return "BundleIdentifierMismatch";
    case kRegistryErrorAlreadyInstalled:
      return kRegistryErrorApplicationAlreadyInstalled;
    case kRegistryErrorFileOperation:
      return "FileOperationFailed";
    case kRegistryErrorInvalidOptions:
      return "InvalidOptions";
    case kRegistryErrorNotReplaceable:
      return "ApplicationNotReplaceable";
  }
  return "UnknownError";
}

// Delivers progress reports to the caller's callback, when there is one.
class Reporter {
 public:
  explicit Reporter(const InstallProgressCallback* callback) : callback_(callback) {}
  void status(const char* status, int percent) const {
    deliver({{kRegistryProgressStatusKey, Value(status)}, {kRegistryProgressPercentKey, Value(percent)}});
  }
  void failure(const Error& error) const {
    const Error* underlying = error.underlyingError();
    deliver({{kRegistryProgressStatusKey, Value(kRegistryStatusFailed)},
             {kRegistryProgressErrorKey, Value(errorName(error.code()))},
             {kRegistryProgressErrorDescriptionKey, Value(error.localizedDescription())},
             {kRegistryProgressErrorDetailKey, Value(underlying ? underlying->description() : error.description())}});
  }

 private:
  // The callback runs on the installation's worker thread, where an exception
  // would end the process; a throwing callback loses that report only.
  void deliver(const Dictionary& report) const {
    if (!callback_ || !*callback_) return;
    try {
      (*callback_)(report);
    } catch (...) {
      SystemLogWrite(nullptr, kFailureLevel, kInstallPackageFunction, "Progress callback threw on report %@; ignored",
                     Value(report));
    }
  }
  const InstallProgressCallback* callback_;
};

bool failWith(Error* error, int64_t code, const std::string& message) {
  if (error) *error = registryError(code, message);
  return false;
}

std::string lastComponent(const std::string& path) {
  return URL::fileURL(path).lastPathComponent();
}

std::string parentOf(const std::string& path) {
  return URL::fileURL(path).deletingLastPathComponent().path();
}

// A bundle to install and where it goes.
struct BundlePlan {
  std::string source;
  BundleInfo info;
  const char* bundleType = kBundleTypeUser;
  bool placeholder = false;
  std::string container;
  std::string bundlePath;
  std::optional<std::string> dataContainer;
  std::map<std::string, std::string> groups;
  std::optional<std::string> replacedContainer;
};

enum class Transfer { Move, Copy };

// One installation: planned bundle by bundle, then run once.
class Installation {
 public:
  Installation(RegistryState& state, Transfer transfer, std::optional<std::string> packagePath, const char* function)
      : state_(state), transfer_(transfer), packagePath_(std::move(packagePath)), function_(function) {}

  // Plans the containers of a bundle. A placeholder gets no group containers.
  bool addBundle(const std::string& source, BundleInfo info, const char* bundleType, bool placeholder, Error* error);
  // An item of the package to keep beside the first bundle.
  void addMetadataItem(const std::string& source) { metadataItems_.push_back(source); }
  void setStoreMetadata(Data bytes) { storeMetadata_ = std::move(bytes); }

  // Journals, takes the file actions, commits, cleans up.
  bool run(const Reporter& reporter, Error* error);

 private:
  bool planDataContainer(BundlePlan* plan, const std::optional<StoredRecord>& existing, Error* error);
  bool planGroups(BundlePlan* plan, Error* error);
  void planCreation(const std::string& path);
  bool takeFileActions(Error* error);
  bool flushFileActionsThenCommit(Error* error) const;
  bool commit(Error* error);
  void rollBack();
  void cleanUp();

  RegistryState& state_;
  const Transfer transfer_;
  const std::optional<std::string> packagePath_;
  const char* function_;
  std::vector<BundlePlan> bundles_;
  std::vector<std::string> metadataItems_;
  std::optional<Data> storeMetadata_;
  std::vector<std::string> creations_;  // directories this installation makes
  std::set<std::string> plannedCreations_;
  std::map<std::string, std::string> newGroups_;  // group identifier to its new container
  std::vector<JournalEntry> journal_;             // creations, then moves, in the order taken
  std::vector<JournalEntry> removals_;            // what the commit leaves to remove
};

bool Installation::addBundle(const std::string& source, BundleInfo info, const char* bundleType, bool placeholder,
                             Error* error) {
  BundlePlan plan;
  plan.source = source;
  plan.info = std::move(info);
  plan.bundleType = bundleType;
  plan.placeholder = placeholder;
  std::optional<StoredRecord> existing;
  {
    std::lock_guard dbLock(state_.dbMutex);
    if (!loadRecord(*state_.db, plan.info.identifier, &existing, error)) return false;
  }
  std::optional<std::string> container = newContainerPath(state_.layout.bundleContainers, error);
  if (!container) return false;
  plan.container = *container;
  plan.bundlePath = path::join(plan.container, lastComponent(source));
  planCreation(plan.container);
  if (existing) {
    if (!checkContainerPath(state_.layout, existing->bundleContainer, state_.layout.bundleContainers, "bundle container", error)) {
      return false;
    }
    plan.replacedContainer = existing->bundleContainer;
  }
  if (!planDataContainer(&plan, existing, error)) return false;
  if (!placeholder && !planGroups(&plan, error)) return false;
  bundles_.push_back(std::move(plan));
  return true;
}

// An identifier keeps its data container across reinstallation and the
// replacement of a placeholder; an application replacing a built-in one takes
// over the built-in one's.
bool Installation::planDataContainer(BundlePlan* plan, const std::optional<StoredRecord>& existing, Error* error) {
  std::optional<std::string> kept = existing ? existing->dataContainer : std::nullopt;
  if (!kept && !existing) {
    std::lock_guard dbLock(state_.dbMutex);
    if (!loadSystemDataContainer(*state_.db, plan->info.identifier, &kept, error)) return false;
  }
  if (kept) {
    // An identifier may have changed kind between installations: either data
    // area is the registry's own.
    if (!liesInArea(state_.layout, *kept, state_.layout.pluginDataContainers) &&
        !checkContainerPath(state_.layout, *kept, state_.layout.applicationDataContainers, "data container", error)) {
      return false;
    }
    plan->dataContainer = *kept;
    if (!isDirectory(*kept)) planCreation(*kept);
    return true;
  }
  bool plugin = std::string(plan->bundleType) == kBundleTypeVPNPlugin;
  plan->dataContainer =
      newContainerPath(plugin ? state_.layout.pluginDataContainers : state_.layout.applicationDataContainers, error);
  if (!plan->dataContainer) return false;
  planCreation(*plan->dataContainer);
  return true;
}

bool Installation::planGroups(BundlePlan* plan, Error* error) {
  for (const std::string& group : plan->info.groups) {
    std::optional<std::string> path;
    if (auto planned = newGroups_.find(group); planned != newGroups_.end()) {
      path = planned->second;
    } else {
      std::lock_guard dbLock(state_.dbMutex);
      if (!loadGroupContainer(*state_.db, group, &path, error)) return false;
    }
    if (!path) {
      path = newContainerPath(state_.layout.groupContainers, error);
      if (!path) return false;
      newGroups_[group] = *path;
    } else if (!checkContainerPath(state_.layout, *path, state_.layout.groupContainers, "group container", error)) {
      return false;
    }
    if (!isDirectory(*path)) planCreation(*path);
    plan->groups[group] = *path;
  }
  return true;
}

void Installation::planCreation(const std::string& path) {
  if (plannedCreations_.insert(path).second) creations_.push_back(path);
}

bool Installation::run(const Reporter& reporter, Error* error) {
  for (const std::string& path : creations_) journal_.push_back({JournalKind::Create, "", path});
  if (transfer_ == Transfer::Move) {
    for (const BundlePlan& plan : bundles_) journal_.push_back({JournalKind::Move, plan.source, plan.bundlePath});
    for (const std::string& item : metadataItems_) {
      journal_.push_back({JournalKind::Move, item, path::join(bundles_.front().container, lastComponent(item))});
    }
  }
  {
    // A move must not reach the disk before the journal entry that undoes it,
    // so the journal of a move is flushed before any file moves. A copy only
    // makes new directories under fresh names: if a power cut loses its
    // journal, they are empty or copied directories that nothing records and
    // nothing else will ever use. Its journal goes to the disk with the
    // commit that records them (same log, written before it), at the barrier.
    const CommitDurability durability =
        transfer_ == Transfer::Move ? CommitDurability::Immediate : CommitDurability::WithNextFlush;
    std::lock_guard dbLock(state_.dbMutex);
    auto transaction = Transaction::begin(*state_.db, error, durability);
    if (!transaction || !appendJournal(*state_.db, journal_, error) || !transaction->commit(error)) return false;
  }
  reporter.status(kRegistryStatusStaging, kPercentStaging);
  if (!takeFileActions(error)) {
    rollBack();
    return false;
  }
  reporter.status(kRegistryStatusRegistering, kPercentRegistering);
  if (!commit(error)) {
    rollBack();
    return false;
  }
  // The commit is visible now but not yet durable. When the barrier fails the
  // records stay (they describe what is on disk); the removals the commit
  // journalled are left to the next recovery, which repeats them harmlessly.
  if (!flushFileActionsThenCommit(error)) return false;
  reporter.status(kRegistryStatusCleaningUp, kPercentCleaningUp);
  cleanUp();
  reporter.status(kRegistryStatusComplete, kPercentComplete);
  return true;
}

bool Installation::takeFileActions(Error* error) {
  for (const JournalEntry& entry : journal_) {
    bool done = entry.kind == JournalKind::Create ? createNewDirectory(entry.destination, error)
                                                  : moveItem(entry.source, entry.destination, error);
    if (!done) return false;
  }
  if (transfer_ == Transfer::Copy) {
    for (const BundlePlan& plan : bundles_) {
      if (!copyTree(plan.source, plan.bundlePath, error)) return false;
    }
  }
  return !storeMetadata_ ||
         writeNewFile(path::join(bundles_.front().container, kStoreMetadataFileName), *storeMetadata_, error);
}

// One barrier makes the installation durable: the file systems of the new
// containers first (their directories, a copy's files, the moves' new names;
// a move's old name is on the same file system), then the registry's own,
// which holds the commit (written to the log without a flush, and with no
// checkpoint that could flush it early). A power cut before the barrier loses
// the commit: a move's flushed journal rolls it back, a copy leaves
// directories that nothing records. Once the commit is on disk, so is
// everything it records; nothing depends on the commit before this returns.
bool Installation::flushFileActionsThenCommit(Error* error) const {
  std::vector<std::string> paths;
  for (const JournalEntry& entry : journal_) paths.push_back(parentOf(entry.destination));
  paths.push_back(parentOf(state_.db->path()));
  return syncFileSystems(paths, error);
}

bool Installation::commit(Error* error) {
  for (const BundlePlan& plan : bundles_) {
    if (plan.replacedContainer && *plan.replacedContainer != plan.container) {
      removals_.push_back({JournalKind::Remove, "", *plan.replacedContainer});
    }
  }
  if (transfer_ == Transfer::Move && packagePath_) removals_.push_back({JournalKind::Remove, "", *packagePath_});

  std::lock_guard dbLock(state_.dbMutex);
  auto transaction = Transaction::begin(*state_.db, error, CommitDurability::WithNextFlush);
  if (!transaction) return false;
  for (const auto& [group, path] : newGroups_) {
    // A lookup of a built-in application of the same group may have recorded
    // a container first; then that one is the group's, and ours is garbage.
    std::optional<std::string> recorded;
    if (!saveGroupContainer(*state_.db, group, path, error) ||
        !loadGroupContainer(*state_.db, group, &recorded, error)) {
      return false;
    }
    if (recorded && *recorded != path) removals_.push_back({JournalKind::Remove, "", path});
  }
  for (const BundlePlan& plan : bundles_) {
    const StoredRecord record{.identifier = plan.info.identifier,
                              .bundleType = plan.bundleType,
                              .bundlePath = plan.bundlePath,
                              .bundleContainer = plan.container,
                              .dataContainer = plan.dataContainer,
                              .isPlaceholder = plan.placeholder,
                              .hasGroupDictionary = !plan.placeholder,
                              .version = plan.info.version,
                              .displayName = plan.info.displayName,
                              .packagePath = packagePath_,
                              .groups = plan.groups};
    if (!saveRecord(*state_.db, record, error)) return false;
  }
  return clearJournal(*state_.db, error) && appendJournal(*state_.db, removals_, error) && transaction->commit(error);
}

// Undoes the file actions and empties the journal. When the journal cannot be
// emptied now, the next installation or opening finds it and undoes it again,
// which finds nothing left to do.
void Installation::rollBack() {
  (void)undoJournal(state_.layout, journal_, function_, nullptr);  // failures are logged; the journal keeps them for later
  std::lock_guard dbLock(state_.dbMutex);
  (void)clearJournal(*state_.db, nullptr);
}

// The emptied journal need not reach the disk by itself: if a power cut
// loses it, the next opening or installation finds only these removals and
// repeats them, which finds nothing left to do (the paths are fresh container
// names and the package directory, which nothing recreates before that
// recovery). The next immediate commit carries it to the disk.
void Installation::cleanUp() {
  (void)undoJournal(state_.layout, removals_, function_, nullptr);  // removal failures are logged and leave only garbage
  std::lock_guard dbLock(state_.dbMutex);
  // Failing here leaves removals the next recovery repeats harmlessly.
  auto transaction = Transaction::begin(*state_.db, nullptr, CommitDurability::WithNextFlush);
  if (transaction && clearJournal(*state_.db, nullptr)) (void)transaction->commit(nullptr);
}

// The contents of a package directory.
struct PackageContents {
  std::optional<std::string> application;
  std::optional<std::string> plugin;
  std::vector<std::string> metadataItems;
};

// Reads the package's layout. *nothing (and false) when there is nothing to
// install: no package, no Payload, or a Payload without a bundle.
bool readPackage(const std::string& package, PackageContents* contents, bool* nothing, Error* error) {
  *nothing = false;
  std::string payload = path::join(package, kPayloadDirectoryName);
  if (!isDirectory(payload)) {
    *nothing = true;
    return failWith(error, kRegistryErrorInvalidPackage,
                    Format("No %s directory in package %s", kPayloadDirectoryName, package));
  }
  auto names = listDirectory(payload, error);
  if (!names) return false;
  size_t applications = 0, plugins = 0;
  for (const std::string& name : *names) {
    std::string item = path::join(payload, name);
    std::string extension = URL::fileURL(item).pathExtension();
    // A symbolic link is no bundle: moving it would install the link.
    if (extension == kApplicationBundleExtension && isDirectoryNoFollow(item)) {
      ++applications;
      contents->application = item;
    } else if (extension == kVPNPluginBundleExtension && isDirectoryNoFollow(item)) {
      ++plugins;
      contents->plugin = item;
    }
  }
  if (applications > 1 || plugins > 1) {
    return failWith(error, kRegistryErrorInvalidPackage,
                    Format("Payload of package %s holds %zu applications and %zu VPN plug-ins; at most one of each "
                           "can be installed",
                           package, applications, plugins));
  }
  if (applications == 0 && plugins == 0) {
    *nothing = true;
    return failWith(error, kRegistryErrorInvalidPackage, Format("Payload of package %s holds no bundle", package));
  }
  auto items = listDirectory(package, error);
  if (!items) return false;
  for (const std::string& name : *items) {
    if (name != kPayloadDirectoryName) contents->metadataItems.push_back(path::join(package, name));
  }
  return true;
}

bool requireInfoIdentifier(const BundleInfo& info, const std::string& bundle, Error* error) {
  if (!info.identifier.empty()) return true;
  return failWith(error, kRegistryErrorInvalidInfoPlist,
                  Format("Info.plist of %s has no %s", bundle, kBundleIdentifierKey));
}

// Relative locations would depend on the working directory of whoever calls.
bool requireAbsolute(const std::string& location, Error* error) {
  if (!location.empty() && location.front() == '/') return true;
  return failWith(error, kRegistryErrorInvalidPackage, Format("Location \"%s\" is not an absolute path", location));
}

// Reads a bundle's Info.plist and requires an identifier.
std::optional<BundleInfo> readIdentifiedBundle(const std::string& bundle, Error* error) {
  std::optional<BundleInfo> info = readBundleInfo(bundle, error);
  if (info && !requireInfoIdentifier(*info, bundle, error)) return std::nullopt;
  return info;
}

// The options' identifier (none when absent); false when it is not a string.
bool optionIdentifier(const Dictionary& options, std::optional<std::string>* identifier, Error* error) {
  auto it = options.find(kBundleIdentifierKey);
  if (it == options.end()) return true;
  if (!it->second.isString()) {
    return failWith(
        error, kRegistryErrorInvalidOptions,
        Format("Option %s is a %s, not a string", kBundleIdentifierKey, std::string(it->second.typeName())));
  }
  *identifier = *it->second.asString();
  return true;
}

// The options' package type, kRegistryPackageTypeCustomer when absent; false
// when it is none of `allowed`.
bool optionPackageType(const Dictionary& options, std::initializer_list<const char*> allowed, std::string* type,
                       Error* error) {
  auto it = options.find(kRegistryPackageTypeKey);
  *type = it == options.end() ? kRegistryPackageTypeCustomer : it->second.description();
  for (const char* candidate : allowed) {
    if (*type == candidate) return true;
  }
  return failWith(error, kRegistryErrorInvalidOptions, Format("Package type %s is not supported here", *type));
}

bool requireIdentifier(const BundleInfo& info, const std::optional<std::string>& expected, const std::string& bundle,
                       Error* error) {
  if (!expected || *expected == info.identifier) return true;
  return failWith(error, kRegistryErrorIdentifierMismatch,
                  Format("Bundle %s has identifier %s, not %s", bundle, info.identifier, *expected));
}

// Refuses a bundle that is not newer than the built-in copy of its identifier.
bool requireNewerThanBuiltIn(RegistryState& state, const BundleInfo& info, Error* error) {
  std::optional<BuiltInApplication> builtIn = state.builtIns.find(info.identifier);
  if (!builtIn || !builtInSupersedes(builtIn->info.version, info.version)) return true;
  return failWith(error, kRegistryErrorAlreadyInstalled,
                  Format("%s version %s is not newer than the built-in application at %s (version %s)", info.identifier,
                         info.version, builtIn->bundlePath, builtIn->info.version));
}

void removePackage(const std::string& package) {
  Error error;
  if (!removeTree(package, &error)) {
    SystemLogWrite(nullptr, kFailureLevel, kInstallPackageFunction, "Could not remove package %s: %@", package, error);
  }
}

// A package whose Payload no longer holds its bundle, installed from before
// for `identifier`: an interrupted caller finishing. Its leftovers go.
bool isReplay(RegistryState& state, const std::string& package, const std::optional<std::string>& identifier) {
  if (!identifier) return false;
  std::optional<StoredRecord> record;
  std::lock_guard dbLock(state.dbMutex);
  return loadRecord(*state.db, *identifier, &record, nullptr) && record && record->packagePath == package;
}

bool installPackageLocked(RegistryState& state, const std::string& package, const Dictionary& options,
                          const Reporter& reporter, Error* error) {
  std::string packageType;
  std::optional<std::string> identifier;
  if (!requireAbsolute(package, error) ||
      !optionPackageType(options, {kRegistryPackageTypeCustomer}, &packageType, error) ||
      !optionIdentifier(options, &identifier, error)) {
    return false;
  }
  PackageContents contents;
  bool nothing = false;
  if (!readPackage(package, &contents, &nothing, error)) {
    if (!nothing || !isReplay(state, package, identifier)) return false;
    removePackage(package);
    reporter.status(kRegistryStatusAlreadyInstalledFromPackage, kPercentComplete);
    return true;
  }
  const std::string& main = contents.application ? *contents.application : *contents.plugin;
  std::optional<BundleInfo> mainInfo = readIdentifiedBundle(main, error);
  if (!mainInfo || !requireIdentifier(*mainInfo, identifier, main, error)) return false;
  std::optional<BundleInfo> pluginInfo;
  if (contents.application && contents.plugin) {
    pluginInfo = readIdentifiedBundle(*contents.plugin, error);
    if (!pluginInfo) return false;
    if (pluginInfo->identifier == mainInfo->identifier) {
      return failWith(
          error, kRegistryErrorInvalidPackage,
          Format("Application and VPN plug-in of package %s share the identifier %s", package, mainInfo->identifier));
    }
  }
  if (!requireNewerThanBuiltIn(state, *mainInfo, error)) {
    removePackage(package);
    return false;
  }

  Installation installation(state, Transfer::Move, package, kInstallPackageFunction);
  if (!installation.addBundle(main, std::move(*mainInfo), contents.application ? kBundleTypeUser : kBundleTypeVPNPlugin,
                              false, error)) {
    return false;
  }
  if (pluginInfo &&
      !installation.addBundle(*contents.plugin, std::move(*pluginInfo), kBundleTypeVPNPlugin, false, error)) {
    return false;
  }
  for (const std::string& item : contents.metadataItems) installation.addMetadataItem(item);
  return installation.run(reporter, error);
}

bool placeholderMetadata(const Dictionary& options, std::optional<Data>* bytes, Error* error) {
  auto it = options.find(kRegistryStoreMetadataKey);
  if (it == options.end()) return true;
  if (!it->second.isData()) {
    return failWith(
        error, kRegistryErrorInvalidOptions,
        Format("Option %s is a %s, not data", kRegistryStoreMetadataKey, std::string(it->second.typeName())));
  }
  *bytes = *it->second.asData();
  return true;
}

// A placeholder stands in for an application that is not installed; it may
// replace an earlier placeholder only.
bool requireReplaceableByPlaceholder(RegistryState& state, const std::string& identifier, Error* error) {
  std::optional<StoredRecord> existing;
  {
    std::lock_guard dbLock(state.dbMutex);
    if (!loadRecord(*state.db, identifier, &existing, error)) return false;
  }
  if ((existing && !existing->isPlaceholder) || state.builtIns.find(identifier)) {
    return failWith(error, kRegistryErrorNotReplaceable,
                    Format("%s is installed; a placeholder cannot replace it", identifier));
  }
  return true;
}

bool installBundleLocked(RegistryState& state, const std::string& bundle, const Dictionary& options, Error* error) {
  std::string packageType;
  std::optional<std::string> identifier;
  if (!requireAbsolute(bundle, error) ||
      !optionPackageType(options, {kRegistryPackageTypeCustomer, kRegistryPackageTypePlaceholder}, &packageType,
                         error) ||
      !optionIdentifier(options, &identifier, error)) {
    return false;
  }
  if (!isDirectory(bundle))
    return failWith(error, kRegistryErrorInvalidPackage, Format("No bundle directory at %s", bundle));
  std::optional<BundleInfo> info = readBundleInfo(bundle, error);
  if (!info) return false;
  const bool placeholder = packageType == kRegistryPackageTypePlaceholder;
  Installation installation(state, Transfer::Copy, std::nullopt, kInstallBundleFunction);
  if (placeholder) {
    // A placeholder's identity is the one it is installed for; its Info.plist
    // carries the application's own values, whatever they are.
    if (identifier) info->identifier = *identifier;
    std::optional<Data> metadata;
    if (info->identifier.empty()) {
      return failWith(error, kRegistryErrorInvalidOptions, Format("No identifier for placeholder %s", bundle));
    }
    if (!placeholderMetadata(options, &metadata, error) ||
        !requireReplaceableByPlaceholder(state, info->identifier, error)) {
      return false;
    }
    info->groups.clear();
    if (metadata) installation.setStoreMetadata(std::move(*metadata));
  } else {
    if (!requireInfoIdentifier(*info, bundle, error) || !requireIdentifier(*info, identifier, bundle, error) ||
        !requireNewerThanBuiltIn(state, *info, error))
      return false;
  }
  const char* type = placeholder ? kBundleTypePlaceholder : kBundleTypeUser;
  return installation.addBundle(bundle, std::move(*info), type, placeholder, error) &&
         installation.run(Reporter(nullptr), error);
}

// Takes the change lock and the install lock file, and finishes whatever an
// interrupted installation left, before `body` runs.
template <class Body>
bool underInstallLocks(RegistryState& state, const char* function, Error* error, Body body) {
  std::lock_guard changeLock(state.changeMutex);
  std::optional<FileLock> fileLock = FileLock::acquire(state.layout.lockPath, error);
  if (!fileLock || !recoverJournalLocked(state, function, error)) return false;
  return body();
}

}  // namespace

bool installPackageDirectory(RegistryState& state, const URL& package, const Dictionary& options,
                             const InstallProgressCallback& progress, Error* error) {
  Reporter reporter(&progress);
  reporter.status(kRegistryStatusVerifying, kPercentVerifying);
  Error failure;
  bool installed = underInstallLocks(state, kInstallPackageFunction, &failure, [&] {
    return checkPackagePath(state.layout, package.path(), &failure) &&
           installPackageLocked(state, package.path(), options, reporter, &failure);
  });
  if (installed) return true;
  reporter.failure(failure);
  if (error) *error = failure;
  return false;
}

bool installBundleDirectory(RegistryState& state, const URL& bundle, const Dictionary& options, Error* error) {
  return underInstallLocks(state, kInstallBundleFunction, error,
                           [&] { return installBundleLocked(state, bundle.path(), options, error); });
}

}  // namespace platform::registry
