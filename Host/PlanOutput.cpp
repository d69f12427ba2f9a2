#include "Host/PlanOutput.h"

#include <cinttypes>
#include <cstdio>

#include "Host/Progress.h"
#include "Platform/Foundation/Json.h"
#include "Platform/Foundation/Text.h"

namespace transvale {

using platform::MigrationPlan;
using platform::PlanDestination;
using platform::PlannedAction;
using platform::PlanSize;

namespace {

constexpr PlannedAction kAllActions[] = {PlannedAction::PlaceholderThenInstall, PlannedAction::PlaceholderOnly,
                                         PlannedAction::AlreadyInstalled,       PlannedAction::RefusedByBuiltIn,
                                         PlannedAction::VPNPluginOnly,          PlannedAction::Kept};

std::string printf(const char* format, auto... arguments) {
  char buffer[512];
  std::snprintf(buffer, sizeof buffer, format, arguments...);
  return buffer;
}

std::string sizeText(const PlanSize& size) {
  return printf("%" PRIu64 " files, %" PRIu64 " bytes", size.files, size.bytes);
}

std::string destinationText(const PlanDestination& destination) {
  return (destination.toBeMade ? "a new container in " : "") + platform::printable(destination.path) +
         (destination.crossesFileSystem ? " (another file system: copied, then removed)" : " (same file system)");
}

void writeSize(platform::JsonWriter& json, const PlanSize& size) {
  json.beginObject();
  json.key("files").number(size.files);
  json.key("bytes").number(size.bytes);
  json.key("directories").number(size.directories);
  json.key("otherItems").number(size.otherItems);
  json.endObject();
}

void writeDestination(platform::JsonWriter& json, const PlanDestination& destination) {
  json.beginObject();
  json.key("path").string(destination.path);
  json.key("toBeMade").boolean(destination.toBeMade);
  json.key("crossesFileSystem").boolean(destination.crossesFileSystem);
  json.endObject();
}

}  // namespace

const char* actionName(PlannedAction action) {
  switch (action) {
    case PlannedAction::PlaceholderThenInstall:
      return "placeholder then install";
    case PlannedAction::PlaceholderOnly:
      return "placeholder only (the old bundle is a placeholder)";
    case PlannedAction::AlreadyInstalled:
      return "already installed";
    case PlannedAction::RefusedByBuiltIn:
      return "refused: an equal or newer built-in copy exists";
    case PlannedAction::VPNPluginOnly:
      return "VPN plug-in only";
    case PlannedAction::Kept:
      return "kept";
  }
  return "kept";
}

const char* discardName(platform::PlannedDiscardKind kind) {
  switch (kind) {
    case platform::PlannedDiscardKind::ContainerWithoutBundle:
      return "container without an identifiable bundle, removed once its data items are recovered";
    case platform::PlannedDiscardKind::StrayFile:
      return "stray file in the old applications directory";
    case platform::PlannedDiscardKind::NoteFile:
      return "the previous release's note file";
  }
  return "";
}

std::string planText(const MigrationPlan& plan) {
  std::string out = "Plan for " + platform::printable(plan.systemRoot) + " (nothing has been changed)\n";
  if (!plan.hasOldLayout) {
    out += "No old application layout: " + platform::printable(plan.oldApplicationsPath) +
           " is missing or empty. A run only registers safe harbors and records the system version.\n";
  } else {
    out += printf("Old applications directory: %s (%" PRIu64 " entries)\n",
                  platform::printable(plan.oldApplicationsPath).c_str(), plan.entries);
  }

  if (!plan.containers.empty()) out += "\nContainers, in the order the run takes them:\n";
  size_t number = 0;
  for (const platform::PlannedContainer& c : plan.containers) {
    out += printf("%4zu. %s: %s%s\n", ++number,
                  c.identifier.empty() ? "(unknown)" : platform::printable(c.identifier).c_str(), actionName(c.action),
                  c.resumedFromMarker ? ", resumed from its migration marker" : "");
    out += "      container: " + platform::printable(c.containerPath) + "\n";
    if (c.action == PlannedAction::Kept) {
      out += "      kept because " + platform::printable(c.reason) + "\n";
      continue;
    }
    out += "      data: " + sizeText(c.data) + " -> " + destinationText(c.dataDestination) + "\n";
    for (const platform::PlannedGroup& g : c.groups) {
      out += "      group " + platform::printable(g.identifier) + ": " + sizeText(g.size) + " from " +
             platform::printable(g.oldPath) + " -> " + destinationText(g.destination) + "\n";
    }
  }

  out += "\nDiscarded for good:";
  if (plan.discards.empty()) out += " nothing";
  out += "\n";
  for (const platform::PlannedDiscard& d : plan.discards) {
    out += "  " + platform::printable(d.path) + ": " + discardName(d.kind) + ", " + sizeText(d.size);
    if (!d.items.empty()) {
      out += "; items:";
      for (const std::string& item : d.items) out += " " + platform::printable(item);
    }
    if (!d.recoveredItems.empty()) {
      out += "; moved first to a directory of its own in " + platform::printable(d.recoveryDirectory) + ":";
      for (const std::string& item : d.recoveredItems) out += " " + platform::printable(item);
    }
    out += "\n";
  }

  if (!plan.harbors.empty()) out += "\nSafe harbors to register:\n";
  for (const platform::PlannedHarbor& h : plan.harbors) {
    out += "  " + platform::printable(h.identifier) + " -> " + platform::printable(h.path) +
           (h.problem.empty() ? "" : " (refused: " + h.problem + ")") + "\n";
  }

  out += "\nTotals:\n";
  for (PlannedAction action : kAllActions) {
    size_t count = 0;
    for (const auto& c : plan.containers) count += c.action == action;
    if (count) out += printf("  %-52s %zu\n", actionName(action), count);
  }
  out += "  to move: " + sizeText(plan.totalData) + "\n";
  PlanSize discarded;
  for (const auto& d : plan.discards) {
    discarded.files += d.size.files;
    discarded.bytes += d.size.bytes;
  }
  out += printf("  discarded: %zu items, ", plan.discards.size()) + sizeText(discarded) + "\n";

  if (!plan.fileSystems.empty()) out += "\nRoom on the destination file systems:\n";
  for (const platform::PlannedFileSystem& f : plan.fileSystems) {
    const bool fits = f.neededBytes <= f.freeBytes;
    out += printf("  %s: %" PRIu64 " bytes needed (%s), %" PRIu64 " bytes free (%s): %s\n",
                  platform::printable(f.path).c_str(), f.neededBytes, humanBytes(f.neededBytes).c_str(), f.freeBytes,
                  humanBytes(f.freeBytes).c_str(), fits ? "enough" : "NOT ENOUGH");
  }
  out += printf("\nEstimated duration: %.1f s\n", plan.estimatedSeconds);
  return out;
}

std::string planJSON(const MigrationPlan& plan) {
  platform::JsonWriter json(true);
  json.beginObject();
  json.key("systemRoot").string(plan.systemRoot);
  json.key("oldApplicationsPath").string(plan.oldApplicationsPath);
  json.key("hasOldLayout").boolean(plan.hasOldLayout);
  json.key("entries").number(plan.entries);
  json.key("containers").beginArray();
  for (const platform::PlannedContainer& c : plan.containers) {
    json.beginObject();
    json.key("identifier").optionalString(c.identifier.empty() ? std::nullopt : std::optional(c.identifier));
    json.key("containerPath").string(c.containerPath);
    json.key("bundlePath").string(c.bundlePath);
    json.key("secondBundlePath").optionalString(c.secondBundlePath);
    json.key("action").string(actionName(c.action));
    json.key("resumedFromMarker").boolean(c.resumedFromMarker);
    json.key("reason").optionalString(c.reason.empty() ? std::nullopt : std::optional(c.reason));
    json.key("data");
    writeSize(json, c.data);
    json.key("dataDestination");
    writeDestination(json, c.dataDestination);
    json.key("groups").beginArray();
    for (const platform::PlannedGroup& g : c.groups) {
      json.beginObject();
      json.key("identifier").string(g.identifier);
      json.key("oldPath").string(g.oldPath);
      json.key("size");
      writeSize(json, g.size);
      json.key("destination");
      writeDestination(json, g.destination);
      json.endObject();
    }
    json.endArray();
    json.endObject();
  }
  json.endArray();
  json.key("discards").beginArray();
  for (const platform::PlannedDiscard& d : plan.discards) {
    json.beginObject();
    json.key("kind").string(discardName(d.kind));
    json.key("path").string(d.path);
    json.key("size");
    writeSize(json, d.size);
    json.key("items").beginArray();
    for (const std::string& item : d.items) json.string(item);
    json.endArray();
    json.key("recoveredItems").beginArray();
    for (const std::string& item : d.recoveredItems) json.string(item);
    json.endArray();
    json.key("recoveryDirectory").string(d.recoveryDirectory);
    json.endObject();
  }
  json.endArray();
  json.key("safeHarbors").beginArray();
  for (const platform::PlannedHarbor& h : plan.harbors) {
    json.beginObject();
    json.key("identifier").string(h.identifier);
    json.key("path").string(h.path);
    json.key("problem").optionalString(h.problem.empty() ? std::nullopt : std::optional(h.problem));
    json.endObject();
  }
  json.endArray();
  json.key("totals").beginObject();
  for (PlannedAction action : kAllActions) {
    uint64_t count = 0;
    for (const auto& c : plan.containers) count += c.action == action;
    json.key(actionName(action)).number(count);
  }
  json.key("toMove");
  writeSize(json, plan.totalData);
  json.key("discarded").number(static_cast<uint64_t>(plan.discards.size()));
  json.endObject();
  json.key("fileSystems").beginArray();
  for (const platform::PlannedFileSystem& f : plan.fileSystems) {
    json.beginObject();
    json.key("path").string(f.path);
    json.key("neededBytes").number(f.neededBytes);
    json.key("freeBytes").number(f.freeBytes);
    json.key("enough").boolean(f.neededBytes <= f.freeBytes);
    json.endObject();
  }
  json.endArray();
  json.key("estimatedSeconds").real(plan.estimatedSeconds, 1);
  json.endObject();
  return json.text() + "\n";
}

}  // namespace transvale
