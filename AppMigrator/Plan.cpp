// The dry run: the old layout walked with the run's own decisions
// (_surveyEntry for introspection, _decideContainerSteps for each container)
// against a read-only registry, and nothing changed. What the registry will
// only make during the run (placeholders' records, the records of VPN
// plug-ins that travel with an application, group containers) is followed in
// QSPlanState, in the order the run would make it.
#include <deque>
#include <map>
#include <set>

#include "AppMigrator/QSAppMigrator.h"
#include "Platform/Registry/BundleInfo.h"
#include "Shared/FileManager/QSFileManager.h"
#include "Shared/Support/QSGlobalConfiguration.h"

using platform::Dictionary;
using platform::MigrationPlan;
using platform::PlanDestination;
using platform::PlannedAction;
using platform::PlannedContainer;
using platform::PlannedDiscard;
using platform::PlannedDiscardKind;
using platform::PlanSize;
using platform::URL;

// What the run will have made by the time it reaches a container.
struct QSPlanState {
  std::set<std::string> recordsMadeByRun;    // identifiers that get a record during the run
  std::optional<Dictionary> groupContainerMap;  // entries not yet taken by an earlier container
  std::map<uint64_t, platform::PlannedFileSystem> fileSystems;  // by device
};

namespace {

// Measured (docs/BENCHMARKS.md, "Plan estimate"): the cost of one container
// (marker, placeholder, staging, registry transactions and their flushes) on
// the demonstration image, and of each byte copied to another file system.
constexpr double kPlanSecondsPerContainer = 0.15;
constexpr double kPlanSecondsPerCopiedByte = 1.0 / (400.0 * 1024 * 1024);
constexpr double kPlanSecondsBase = 0.3;

void add(PlanSize& total, const PlanSize& more) {
  total.files += more.files;
  total.bytes += more.bytes;
  total.directories += more.directories;
  total.otherItems += more.otherItems;
}


// Where items of `source` go when they move to `destination`, and the room
// that takes there.
PlanDestination destinationFor(const URL& source, const URL& destination, bool toBeMade, uint64_t bytes,
                               QSPlanState& state) {
  const QSFileManager& fm = QSFileManager::defaultManager();
  PlanDestination planned{destination.path(), toBeMade, false};
  QSFileSystemSpace from, to;
  if (!fm.fileSystemSpaceForURL(source, &from) || !fm.fileSystemSpaceForURL(destination, &to)) return planned;
  planned.crossesFileSystem = from.device != to.device;
  platform::PlannedFileSystem& fileSystem = state.fileSystems[to.device];
  if (fileSystem.path.empty()) fileSystem = {to.device, to.existingPath, 0, to.freeBytes};
  if (planned.crossesFileSystem && bytes > 0) fileSystem.neededBytes += bytes;
  return planned;
}

std::optional<std::string> bundleString(platform::BundleReader& reader, const URL& bundle, const char* key) {
  std::shared_ptr<platform::Bundle> opened = reader.openBundle(bundle);
  if (!opened || !opened->info()) return std::nullopt;
  const std::string* value = QSStringForKey(*opened->info(), key);
  return value ? std::optional<std::string>(*value) : std::nullopt;
}

std::vector<std::string> bundleGroups(platform::BundleReader& reader, const URL& bundle) {
  std::vector<std::string> groups;
  std::shared_ptr<platform::Bundle> opened = reader.openBundle(bundle);
  if (!opened || !opened->info()) return groups;
  const platform::Value* value = QSValueForKey(*opened->info(), platform::kApplicationGroupsKey);
  if (!value || !value->isArray()) return groups;
  for (const platform::Value& group : *value->asArray()) {
    if (group.isString()) groups.push_back(*group.asString());
  }
  return groups;
}

PlannedContainer kept(PlannedContainer container, std::string reason) {
  container.action = PlannedAction::Kept;
  container.reason = std::move(reason);
  return container;
}

}  // namespace

MigrationPlan QSAppMigrator::planMigration() {
  QSGlobalConfiguration& configuration = QSGlobalConfiguration::sharedInstance();
  const QSFileManager& fm = QSFileManager::defaultManager();
  MigrationPlan plan;
  plan.systemRoot = configuration.systemRoot().empty() ? "/" : configuration.systemRoot();
  plan.oldApplicationsPath = configuration.oldContainerPath().path();
  plan.hasOldLayout = _itemsToMigrate.has_value();

  // Introspection, as the run does it, without its removals.
  std::deque<std::pair<Dictionary, bool>> workList;  // container information, from a marker
  for (const URL& entry : _itemsToMigrate.value_or(std::vector<URL>())) {
    ++plan.entries;
    if (entry.lastPathComponent() == kQSOldApplicationsNoteFileName) {
      plan.discards.push_back({PlannedDiscardKind::NoteFile, entry.path(), _measureItem(entry), {}, {}, {}});
      continue;
    }
    QSEntrySurvey survey = _surveyEntry(entry);
    switch (survey.finding) {
      case QSEntrySurvey::Finding::Container:
        if (survey.orderEarly) {
          workList.emplace_front(std::move(*survey.info), survey.fromMarker);
        } else {
          workList.emplace_back(std::move(*survey.info), survey.fromMarker);
        }
        break;
      case QSEntrySurvey::Finding::StrayFile:
        plan.discards.push_back({PlannedDiscardKind::StrayFile, entry.path(), _measureItem(entry), {}, {}, {}});
        break;
      case QSEntrySurvey::Finding::NoBundle: {
        PlannedDiscard discard{PlannedDiscardKind::ContainerWithoutBundle, entry.path(), _measureItem(entry), {}, {}, {}};
        for (const URL& item : fm.urlsForItemsInDirectoryAtURL(entry, false).value_or(std::vector<URL>())) {
          discard.items.push_back(item.lastPathComponent());
        }
        for (const URL& item : _recoverableItems(entry, survey.unreadableBundles)) {
          if (fm.itemExistsAtURL(item)) discard.recoveredItems.push_back(item.lastPathComponent());
        }
        discard.recoveryDirectory = QSGlobalConfiguration::sharedInstance().recoveryDirectoryPath().path();
        plan.discards.push_back(std::move(discard));
        break;
      }
      case QSEntrySurvey::Finding::Vanished:
        break;
      case QSEntrySurvey::Finding::Unreadable:
      case QSEntrySurvey::Finding::Unsafe: {
        PlannedContainer container;
        container.containerPath = entry.path();
        plan.containers.push_back(kept(std::move(container), survey.reason));
        break;
      }
    }
  }

  // The containers in the run's order; kept ones found by introspection first.
  QSPlanState state;
  state.groupContainerMap = _groupContainerMap;
  for (const auto& [info, fromMarker] : workList) plan.containers.push_back(_planContainer(info, fromMarker, state));

  if (_harborMap) {
    for (const auto& [identifier, entry] : *_harborMap) {
      const Dictionary* harbor = entry.asDictionary();
      const std::string* path = harbor ? QSStringForKey(*harbor, kQSHarborPathKey) : nullptr;
      std::string problem;
      bool isLink = false;
      if (!path) {
        problem = "the entry has no harbor path";
      } else if (fm.itemDoesNotExistAtURL(URL::fileURL(*path, true))) {
        problem = "the harbor directory does not exist";
      } else if (!fm.isSymbolicLinkAtURL(URL::fileURL(*path), &isLink) || isLink) {
        problem = "the harbor path is a symbolic link";
      }
      plan.harbors.push_back({identifier, path ? *path : "", problem});
    }
  }

  uint64_t copiedBytes = 0;
  for (const PlannedContainer& container : plan.containers) {
    if (container.action == PlannedAction::Kept) continue;
    add(plan.totalData, container.data);
    if (container.dataDestination.crossesFileSystem) copiedBytes += container.data.bytes;
    for (const platform::PlannedGroup& group : container.groups) {
      add(plan.totalData, group.size);
      if (group.destination.crossesFileSystem) copiedBytes += group.size.bytes;
    }
  }
  for (auto& [device, fileSystem] : state.fileSystems) {
    if (fileSystem.neededBytes > 0) fileSystem.neededBytes = QSNeededRoomWithMargin(fileSystem.neededBytes);
    plan.fileSystems.push_back(fileSystem);
  }
  plan.estimatedSeconds = kPlanSecondsBase + kPlanSecondsPerContainer * static_cast<double>(plan.containers.size()) +
                          kPlanSecondsPerCopiedByte * static_cast<double>(copiedBytes);
  return plan;
}

PlannedContainer QSAppMigrator::_planContainer(const Dictionary& info, bool fromMarker, QSPlanState& state) {
  PlannedContainer planned;
  planned.resumedFromMarker = fromMarker;
  const std::optional<QSContainerInfo> in = _readContainerInfo(info);
  if (const std::string* path = QSStringForKey(info, kQSContainerPathKey)) planned.containerPath = *path;
  if (!in) return kept(std::move(planned), "its container information is incomplete");
  planned.identifier = in->identifier;
  planned.bundlePath = in->bundle.path();
  if (in->secondBundle) planned.secondBundlePath = in->secondBundle->path();
  planned.data = _measureUserData(in->container);

  platform::RegistryForecast& forecast = *services_.forecast;
  const QSContainerSteps steps = _decideContainerSteps(*in);
  const bool application = in->type == kQSContainerTypeApp;
  std::optional<platform::BundleRecord> record;
  URL destination;
  bool toBeMade = false;
  if (application && steps.needsPlaceholder) {
    planned.action = steps.installsBundle() ? PlannedAction::PlaceholderThenInstall : PlannedAction::PlaceholderOnly;
    destination = forecast.newDataContainerDirectory(false);
    toBeMade = true;
  } else {
    record = services_.registry->recordForIdentifier(in->identifier);
    if (record && record->dataContainerURL) {
      destination = *record->dataContainerURL;
    } else if (record && record->dataContainerToBeMade) {
      destination = forecast.newDataContainerDirectory(!application);
      toBeMade = true;
    } else if (!record && !application && state.recordsMadeByRun.count(in->identifier)) {
      destination = forecast.newDataContainerDirectory(true);
      toBeMade = true;
    } else if (!record) {
      return kept(std::move(planned), application ? "the registry has no record for it"
                                                  : "no record for the plug-in, and no application of this run "
                                                    "installs it");
    } else {
      return kept(std::move(planned), "its record has no data container");
    }
    const std::optional<std::string> version = bundleString(*services_.bundleReader, in->bundle,
                                                            platform::kBundleVersionKey);
    if (!application) {
      planned.action = PlannedAction::VPNPluginOnly;
    } else if (steps.installsBundle() && version && forecast.refusesAsNotNewerThanBuiltIn(in->identifier, *version)) {
      planned.action = PlannedAction::RefusedByBuiltIn;
    } else {
      planned.action = PlannedAction::AlreadyInstalled;
    }
  }
  planned.dataDestination = destinationFor(in->container, destination, toBeMade, planned.data.bytes, state);
  state.recordsMadeByRun.insert(in->identifier);
  if (!steps.installsBundle() || !application) return planned;

  if (in->secondBundle) {
    if (std::optional<std::string> plugin = _bundleIdentifierForBundle(*in->secondBundle)) {
      state.recordsMadeByRun.insert(*plugin);
    }
  }
  // The groups of the record after installation: the built-in copy's when it
  // refuses the bundle, the bundle's own otherwise.
  std::vector<std::string> groups;
  if (planned.action == PlannedAction::RefusedByBuiltIn && record && record->groupContainerURLs) {
    for (const auto& [group, url] : *record->groupContainerURLs) groups.push_back(group);
  } else {
    groups = bundleGroups(*services_.bundleReader, in->bundle);
  }
  if (!state.groupContainerMap) return planned;
  for (const std::string& group : groups) {
    const platform::Value* entry = QSValueForKey(*state.groupContainerMap, group);
    const platform::Value* path = entry ? entry->get(kQSGroupContainerPathKey) : nullptr;
    if (!path || !path->isString()) continue;
    const URL oldContainer = URL::fileURL(*path->asString(), true);
    // A container that the run leaves where it is (its refusal is logged
    // then) is neither measured nor planned.
    if (_groupContainerRefusal(oldContainer, group)) continue;
    if (QSFileManager::defaultManager().itemDoesNotExistAtURL(oldContainer)) continue;
    platform::PlannedGroup plannedGroup{group, oldContainer.path(), _measureItem(oldContainer), {}};
    const std::optional<URL> existing = forecast.groupContainerForGroup(group);
    plannedGroup.destination = destinationFor(oldContainer, existing.value_or(forecast.newGroupContainerDirectory()),
                                              !existing, plannedGroup.size.bytes, state);
    planned.groups.push_back(std::move(plannedGroup));
    state.groupContainerMap->erase(group);
  }
  return planned;
}
