#include "Tools/devicegen/Verifier.h"

#include "Platform/Foundation/Json.h"

#include <map>
#include <optional>
#include <set>

#include "Platform/Foundation/PropertyList.h"
#include "Platform/Foundation/Text.h"
#include "Platform/Registry/SQLiteRegistry.h"
#include "Tools/devicegen/FileOps.h"
#include "Tools/devicegen/Layout.h"
#include "Tools/devicegen/Manifest.h"

namespace devicegen {
namespace {

using platform::BundleRecord;

// Entries of a remaining old applications directory named one by one.
constexpr size_t kListedLeftoverLimit = 10;

constexpr const char* kProblemKindNames[] = {"missing", "changed", "left behind", "registry", "version"};
static_assert(std::size(kProblemKindNames) == static_cast<size_t>(ProblemKind::Count));

std::string show(const std::string& bytes) {
  return platform::printable(bytes);
}

class ImageVerifier {
 public:
  ImageVerifier(const std::string& root, const Manifest& manifest, platform::SQLiteApplicationRegistry& registry,
                VerifyResult& result)
      : layout_(root), manifest_(manifest), registry_(registry), result_(result) {}

  void run() {
    summarise();
    // The few problems that say most come first, so that they make the
    // bounded list; item problems can be as many as there are items.
    checkOldLayoutGone();
    checkRecords();
    checkSafeHarbors();
    checkSystemVersion();
    collectGroupContainers();
    for (const ManifestItem& item : manifest_.items) checkItem(item);
  }

 private:
  void summarise() {
    VerifySummary& s = result_.summary;
    for (const ManifestContainer& c : manifest_.containers) {
      if (c.kind == ManifestContainer::Kind::VPNOnly) {
        ++s.vpnOnlyContainers;
        continue;
      }
      ++s.applications;
      s.placeholders += c.placeholder;
      s.builtInRefusals += c.builtInRefusal;
    }
    s.groups = manifest_.groups.size();
    s.harbors = manifest_.harbors.size();
    for (const ManifestItem& item : manifest_.items) {
      switch (item.kind) {
        case ManifestItem::Kind::File:
          ++s.files;
          s.bytes += item.size;
          break;
        case ManifestItem::Kind::Directory:
          ++s.directories;
          break;
        case ManifestItem::Kind::Link:
          ++s.links;
          break;
      }
    }
  }

  const std::optional<BundleRecord>& record(const std::string& identifier) {
    auto found = records_.find(identifier);
    if (found == records_.end()) found = records_.emplace(identifier, registry_.recordForIdentifier(identifier)).first;
    return found->second;
  }

  void checkRecords() {
    for (const ManifestContainer& c : manifest_.containers) {
      const std::optional<BundleRecord>& rec = record(c.identifier);
      if (!rec) {
        result_.add(ProblemKind::Registry, "not installed: " + show(c.identifier) + " (from " + c.containerPath + ")");
        continue;
      }
      if (rec->isPlaceholder && !c.placeholder) {
        result_.add(ProblemKind::Registry, "still a placeholder: " + show(c.identifier));
      }
      if (c.builtInRefusal && rec->bundleType != platform::kBundleTypeSystem) {
        result_.add(ProblemKind::Registry, "built-in copy replaced: " + show(c.identifier) + " has bundle type " +
                                               rec->bundleType + ", expected " + platform::kBundleTypeSystem);
      }
      if (!rec->dataContainerURL) {
        result_.add(ProblemKind::Registry, "no data container: " + show(c.identifier));
      }
      if (!c.vpnPluginIdentifier.empty() && !record(c.vpnPluginIdentifier)) {
        result_.add(ProblemKind::Registry, "VPN plug-in not installed: " + show(c.vpnPluginIdentifier) +
                                               " (carried by " + show(c.identifier) + ")");
      }
    }
  }

  // A group container is found through the records that name the group; a
  // group shared by several applications has one container.
  void collectGroupContainers() {
    for (const BundleRecord& rec : registry_.allRecords()) {
      if (!rec.groupContainerURLs) continue;
      for (const auto& [group, url] : *rec.groupContainerURLs) groupContainers_[group].insert(url.path());
    }
  }

  void checkItem(const ManifestItem& item) {
    std::vector<std::string> bases;
    std::string owner;
    if (item.owner == ManifestItem::Owner::Application) {
      owner = "data of " + show(item.ownerIdentifier);
      const std::optional<BundleRecord>& rec = record(item.ownerIdentifier);
      if (rec && rec->dataContainerURL) bases.push_back(rec->dataContainerURL->path());
    } else {
      owner = "group " + show(item.ownerIdentifier);
      const auto found = groupContainers_.find(item.ownerIdentifier);
      if (found != groupContainers_.end()) bases.assign(found->second.begin(), found->second.end());
    }
    if (bases.empty()) {
      result_.add(ProblemKind::Missing, show(item.path) + " (" + owner + "): no container registered");
      return;
    }
    std::string firstProblem;
    ProblemKind firstKind = ProblemKind::Missing;
    for (const std::string& base : bases) {
      ProblemKind kind;
      const std::string problem = compare(item, base + "/" + item.path, &kind);
      if (problem.empty()) return;
      if (firstProblem.empty()) {
        firstProblem = problem;
        firstKind = kind;
      }
    }
    result_.add(firstKind, firstProblem + " (" + owner + ")");
  }

  // "" when the item at `path` is what the manifest says; otherwise what is
  // wrong with it.
  std::string compare(const ManifestItem& item, const std::string& path, ProblemKind* kind) {
    uint64_t size = 0;
    const ItemKind found = itemKind(path, &size);
    *kind = ProblemKind::Changed;
    if (found == ItemKind::Missing) {
      *kind = ProblemKind::Missing;
      return show(path);
    }
    switch (item.kind) {
      case ManifestItem::Kind::Directory:
        return found == ItemKind::Directory ? "" : show(path) + ": not a directory any more";
      case ManifestItem::Kind::Link: {
        if (found != ItemKind::Link) return show(path) + ": not a symbolic link any more";
        const std::optional<std::string> target = readLinkText(path);
        if (target && *target == item.linkTarget) return "";
        return show(path) + ": link reads \"" + show(target.value_or("")) + "\", expected \"" + show(item.linkTarget) +
               "\"";
      }
      case ManifestItem::Kind::File: {
        if (found != ItemKind::File) return show(path) + ": not a regular file any more";
        if (size != item.size) {
          return show(path) + ": " + std::to_string(size) + " bytes, expected " + std::to_string(item.size);
        }
        platform::SHA256Digest digest;
        std::string why;
        if (!digestOfFile(path, readBuffer_, &digest, &size, &why)) return show(why);
        if (digest != item.digest) {
          return show(path) + ": content differs (SHA-256 " + platform::hexString(digest.data(), digest.size()) +
                 ", expected " + platform::hexString(item.digest.data(), item.digest.size()) + ")";
        }
        return "";
      }
    }
    return "";
  }

  void leftBehindIfPresent(const std::string& path, const std::string& what) {
    if (itemKind(path) != ItemKind::Missing) result_.add(ProblemKind::LeftBehind, what + " " + show(path));
  }

  void checkOldLayoutGone() {
    const std::string oldApplications = layout_.oldApplicationsDirectory();
    if (const auto entries = directoryEntries(oldApplications)) {
      result_.add(ProblemKind::LeftBehind, "old applications directory " + show(oldApplications) + " (" +
                                               std::to_string(entries->size()) + " entries)");
      // Name the first few; the count above says how many there are.
      for (size_t k = 0; k < entries->size() && k < kListedLeftoverLimit; ++k) {
        result_.add(ProblemKind::LeftBehind, "old container " + show(oldApplications + "/" + (*entries)[k]));
      }
    } else {
      leftBehindIfPresent(oldApplications, "old applications directory");
    }
    leftBehindIfPresent(layout_.installMap(), "old install map");
    for (const ManifestGroup& group : manifest_.groups) {
      leftBehindIfPresent(layout_.absolute(group.containerPath),
                          "old group container of " + show(group.identifier) + ":");
    }
  }

  void checkSafeHarbors() {
    std::set<std::pair<std::string, std::string>> registered;
    for (const platform::SafeHarborRecord& h : registry_.safeHarbors()) registered.insert({h.identifier, h.path});
    bool all = true;
    for (const ManifestHarbor& harbor : manifest_.harbors) {
      const std::string path = layout_.absolute(harbor.path);
      if (!registered.count({harbor.identifier, path})) {
        all = false;
        result_.add(ProblemKind::Registry,
                    "safe harbor not registered: " + show(harbor.identifier) + " at " + show(path));
      }
      if (itemKind(path) != ItemKind::Directory) result_.add(ProblemKind::Missing, "safe harbor " + show(path));
    }
    // While a harbor is unregistered the map must stay for the next run.
    if (all) leftBehindIfPresent(layout_.safeHarborMap(), "safe-harbor map");
  }

  void checkSystemVersion() {
    const std::string recordPath = layout_.lastSystemVersionRecord();
    platform::Error error;
    const auto recorded = platform::plist::readDictionary(platform::URL::fileURL(recordPath), &error);
    if (!recorded) {
      result_.add(ProblemKind::Version, "no last system version: " + show(recordPath) + ": " + error.description());
      return;
    }
    const auto current = platform::plist::readDictionary(platform::URL::fileURL(layout_.systemVersionFile()), &error);
    if (!current) {
      result_.add(ProblemKind::Version,
                  "cannot read " + show(layout_.systemVersionFile()) + ": " + error.description());
      return;
    }
    if (*recorded != *current) {
      result_.add(ProblemKind::Version, show(recordPath) + " holds " + platform::Value(*recorded).description() +
                                            ", the system is " + platform::Value(*current).description());
    }
  }

  DeviceLayout layout_;
  const Manifest& manifest_;
  platform::SQLiteApplicationRegistry& registry_;
  VerifyResult& result_;
  std::map<std::string, std::optional<BundleRecord>> records_;
  std::map<std::string, std::set<std::string>> groupContainers_;
  std::vector<uint8_t> readBuffer_;
};

}  // namespace

uint64_t VerifyResult::problemCount() const {
  uint64_t total = 0;
  for (uint64_t count : counts) total += count;
  return total;
}

void VerifyResult::add(ProblemKind kind, std::string text) {
  ++counts[static_cast<size_t>(kind)];
  if (listed.size() < kListedProblemLimit) listed.push_back({kind, std::move(text)});
}

VerifyResult verifyImage(const std::string& root) {
  VerifyResult result;
  DeviceLayout layout(root);
  std::string why;
  const std::optional<Manifest> manifest = readManifest(layout.manifest(), &why);
  if (!manifest) {
    result.fatal = why;
    return result;
  }
  platform::Error error;
  std::unique_ptr<platform::SQLiteApplicationRegistry> registry =
      platform::SQLiteApplicationRegistry::open(root, &error);
  if (!registry) {
    result.fatal = "cannot open the registry under " + root + ": " + error.description();
    return result;
  }
  ImageVerifier(root, *manifest, *registry, result).run();
  return result;
}

void printVerifyResult(const std::string& root, const VerifyResult& result, FILE* out) {
  if (!result.fatal.empty()) {
    fprintf(out, "devicegen verify: %s\nFAILED: %s\n", platform::printable(root).c_str(),
            platform::printable(result.fatal).c_str());
    return;
  }
  const VerifySummary& s = result.summary;
  fprintf(out, "devicegen verify: %s\n", platform::printable(root).c_str());
  fprintf(out,
          "  applications: %llu (%llu placeholders, %llu kept as built-in), VPN-only containers: %llu, groups: %llu, "
          "safe harbors: %llu\n",
          static_cast<unsigned long long>(s.applications), static_cast<unsigned long long>(s.placeholders),
          static_cast<unsigned long long>(s.builtInRefusals), static_cast<unsigned long long>(s.vpnOnlyContainers),
          static_cast<unsigned long long>(s.groups), static_cast<unsigned long long>(s.harbors));
  fprintf(out, "  files: %llu (%llu bytes), directories: %llu, links: %llu\n", static_cast<unsigned long long>(s.files),
          static_cast<unsigned long long>(s.bytes), static_cast<unsigned long long>(s.directories),
          static_cast<unsigned long long>(s.links));
  if (result.ok()) {
    fprintf(out, "OK: every item is in its new container, intact; nothing of the old layout is left\n");
    return;
  }
  fprintf(out, "problems: %llu", static_cast<unsigned long long>(result.problemCount()));
  const char* separator = " (";
  for (size_t k = 0; k < static_cast<size_t>(ProblemKind::Count); ++k) {
    if (result.counts[k] == 0) continue;
    fprintf(out, "%s%s %llu", separator, kProblemKindNames[k], static_cast<unsigned long long>(result.counts[k]));
    separator = ", ";
  }
  fprintf(out, ")\n");
  for (const Problem& p : result.listed) {
    fprintf(out, "  %s: %s\n", kProblemKindNames[static_cast<size_t>(p.kind)], p.text.c_str());
  }
  if (result.problemCount() > result.listed.size()) {
    fprintf(out, "  ... and %llu more\n",
            static_cast<unsigned long long>(result.problemCount() - result.listed.size()));
  }
  fprintf(out, "FAILED\n");
}

std::string verifyResultJSON(const std::string& root, const VerifyResult& result) {
  const VerifySummary& s = result.summary;
  platform::JsonWriter json;
  json.beginObject();
  json.key("root").string(root);
  json.key("ok").boolean(result.ok());
  json.key("fatal").optionalString(result.fatal.empty() ? std::nullopt : std::optional(result.fatal));
  json.key("summary").beginObject();
  const std::pair<const char*, uint64_t> figures[] = {
      {"applications", s.applications}, {"placeholders", s.placeholders},
      {"builtInRefusals", s.builtInRefusals}, {"vpnOnlyContainers", s.vpnOnlyContainers},
      {"groups", s.groups}, {"safeHarbors", s.harbors}, {"files", s.files}, {"bytes", s.bytes},
      {"directories", s.directories}, {"links", s.links}};
  for (const auto& [name, value] : figures) json.key(name).number(value);
  json.endObject();
  json.key("problemCounts").beginObject();
  for (size_t k = 0; k < static_cast<size_t>(ProblemKind::Count); ++k) {
    json.key(kProblemKindNames[k]).number(result.counts[k]);
  }
  json.endObject();
  json.key("problems").beginArray();
  for (const Problem& p : result.listed) {
    json.beginObject();
    json.key("kind").string(kProblemKindNames[static_cast<size_t>(p.kind)]);
    json.key("text").string(p.text);
    json.endObject();
  }
  json.endArray();
  json.endObject();
  return json.text() + "\n";
}

}  // namespace devicegen
