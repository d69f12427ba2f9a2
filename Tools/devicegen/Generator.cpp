#include "Tools/devicegen/Generator.h"

#include <algorithm>
#include <cctype>
#include <vector>

#include "Platform/BundleReader.h"
#include "Platform/Foundation/PropertyList.h"
#include "Platform/Imaging.h"
#include "Platform/SystemVersion.h"
#include "Shared/FileManager/QSFileManager.h"
#include "Tools/devicegen/FileOps.h"
#include "Tools/devicegen/Layout.h"
#include "Tools/devicegen/PngIcon.h"
#include "Tools/devicegen/Random.h"

namespace devicegen {
namespace {

using platform::Dictionary;
using platform::Value;

constexpr char kIdentifierPrefix[] = "com.example.";
constexpr char kGroupIdentifierPrefix[] = "group.com.example.shared";
constexpr char kRetiredIdentifierPrefix[] = "com.example.retired";
constexpr char kPluginSuffix[] = "Tunnel";
constexpr char kPluginIdentifierSuffix[] = ".tunnel";
constexpr char kExecutableScript[] = "#!/bin/sh\nexit 0\n";
constexpr char kProductName[] = "Quill OS";
constexpr char kOldApplicationsNote[] = "Applications now live in containers managed by the installation daemon.\n";
constexpr char kGeoJSONDocument[] = "{\"type\":\"FeatureCollection\",\"features\":[]}\n";
constexpr char kHarborKeptFile[] = "Documents/kept.txt";
constexpr char kHarborKeptText[] = "kept in a safe harbor\n";
// The one name in an image that is not UTF-8 (0xFF and 0xFE never occur in
// UTF-8), so that the migration is shown to carry names as bytes.
constexpr char kInvalidUTF8Name[] = "raw-\xFF\xFE-bytes.bin";
constexpr size_t kArtworkBytes = 2048;
constexpr int kIconSizes[] = {29, 40, 58, 60, 76, 87, 120, 152, 180};

constexpr const char* kFirstWords[] = {"Pixel", "Quill", "Harbor", "Amber",  "Cobalt", "Drift",
                                       "Ember", "Fable", "Glyph",  "Hollow", "Ivory",  "Jolt",
                                       "Kite",  "Lumen", "Maple",  "Nimbus", "Orbit",  "Pebble"};
constexpr const char* kSecondWords[] = {"Notes",  "Maps",  "Camera",  "Tasks",  "Radio", "Ledger",
                                        "Garden", "Atlas", "Reader",  "Studio", "Chat",  "Budget",
                                        "Relay",  "Forge", "Recipes", "Journal"};

// The built-in applications every image has, besides the newer copies of old
// applications.
struct PlainBuiltIn {
  const char* name;
  const char* identifier;
  const char* version;
  bool noDataContainer;
};
constexpr PlainBuiltIn kPlainBuiltIns[] = {
    {"Clock", "com.example.system.clock", "3.0", false},
    {"Settings", "com.example.system.settings", "3.0.2", true},
    {"Camera", "com.example.system.camera", "3.1", false},
};

// The shape of a tree of user data: which directories exist, where generated
// files go (cycled through as files are added), which items are always there.
struct Slot {
  const char* directory;
  const char* prefix;
  const char* suffix;
};
struct TreeShape {
  std::vector<const char*> directories;
  std::vector<const char*> emptyDirectories;
  std::vector<Slot> slots;
  const char* preferencesDirectory;
  const char* emptyFile;
  std::vector<std::pair<const char*, const char*>> links;  // path, relative target
};

const TreeShape& applicationDataShape() {
  static const TreeShape* shape =
      new TreeShape{{"Documents", "Library", "Library/Preferences", "Library/Caches", "tmp", "Tillbox"},
                    {"Tillbox/Drafts", "Library/Caches/Empty Cache"},
                    {{"Documents", "Note ", ".txt"},
                     {"Documents/Projects/2024", "Draft ", ".md"},
                     {"Library/Caches", "cache-", ".bin"},
                     {"tmp", "upload ", ".part"},
                     {"Tillbox/Inbox/Attachments", "photo-", ".jpg"},
                     {"Documents", "Caf\u00e9 menu ", ".txt"},
                     {"Tillbox/Inbox", "\u65e5\u672c\u8a9e ", ".txt"},
                     {"Library/Application Support", "state ", ".db"}},
                    "Library/Preferences",
                    "Documents/empty.dat",
                    {{"Documents/Latest", "empty.dat"}, {"Library/Documents Link", "../Documents"}}};
  return *shape;
}

const TreeShape& groupDataShape() {
  static const TreeShape* shape = new TreeShape{{"Library", "Library/Preferences", "Library/Caches", "Shared"},
                                                {"Shared/Inbox"},
                                                {{"Shared", "shared ", ".dat"},
                                                 {"Shared/Media/Albums", "Album ", ".json"},
                                                 {"Library/Caches", "group-cache-", ".bin"}},
                                                "Library/Preferences",
                                                "Shared/empty",
                                                {{"Shared/Latest", "empty"}}};
  return *shape;
}

enum class Role { Regular, Placeholder, BuiltInOlder };

struct AppPlan {
  size_t index = 0;
  Role role = Role::Regular;
  std::string name;  // bundle and executable name
  std::string displayName;
  std::string identifier;
  std::string version;
  std::string shortVersion;
  std::string uuid;
  bool hasDisplayName = true;
  bool hasShortVersion = true;
  bool binaryInfoPlist = false;
  int iconSize = 60;
  int hue = 0;
  std::string pluginName;  // "" without a VPN plug-in
  std::string pluginIdentifier;
  std::vector<std::string> groups;
  enum class StoreMetadata { None, MetadataOnly, All } storeMetadata = StoreMetadata::None;
  bool invalidUTF8Name = false;
  std::string builtInVersion;  // for Role::BuiltInOlder
};

struct GroupPlan {
  std::string identifier;
  std::string uuid;
  std::vector<std::string> members;
};

struct VPNOnlyPlan {
  std::string uuid;
  const AppPlan* carrier = nullptr;
};

std::string lowercase(std::string text) {
  std::transform(text.begin(), text.end(), text.begin(), [](unsigned char c) { return std::tolower(c); });
  return text;
}

std::string join(const std::string& directory, const std::string& name) {
  return directory + "/" + name;
}

class ImageWriter {
 public:
  ImageWriter(const ImageOptions& options, Manifest* manifest)
      : options_(options), layout_(options.root), random_(options.seed), manifest_(*manifest) {}

  bool write(std::string* why) {
    manifest_ = Manifest{};
    manifest_.seed = options_.seed;
    plan();
    return makeDirectories(why) && writeSystemVersion(why) && writeBuiltIns(why) && writeApplications(why) &&
           writeVPNOnlyContainers(why) && writeGroups(why) && writeOldApplicationsNote(why) && writeInstallMap(why) &&
           writeSafeHarbors(why) && writeManifest(manifest_, layout_.manifest(), why);
  }

 private:
  // --- Planning: every decision, drawn from the generator in a fixed order.

  void plan() {
    const size_t count = options_.applications;
    apps_.resize(count);
    for (size_t i = 0; i < count; ++i) planApplication(i, apps_[i]);

    const std::vector<size_t> order = random_.permutation(count);
    const size_t placeholders = options_.placeholders, older = options_.builtInOlder;
    for (size_t k = 0; k < count; ++k) {
      AppPlan& app = apps_[order[k]];
      if (k < placeholders) {
        app.role = Role::Placeholder;
      } else if (k < placeholders + older) {
        app.role = Role::BuiltInOlder;
        app.builtInVersion = (k % 2 == 0) ? app.version : std::to_string(majorVersion(app.version) + 1) + ".0";
      } else {
        regular_.push_back(&app);
      }
    }
    std::sort(regular_.begin(), regular_.end(), [](const AppPlan* a, const AppPlan* b) { return a->index < b->index; });
    planPlugins();
    planGroups();
    for (AppPlan& app : apps_) planStoreMetadata(app);
    if (!regular_.empty()) regular_.front()->invalidUTF8Name = true;
  }

  void planApplication(size_t i, AppPlan& app) {
    app.index = i;
    const char* first = kFirstWords[random_.between(0, std::size(kFirstWords) - 1)];
    const char* second = kSecondWords[random_.between(0, std::size(kSecondWords) - 1)];
    const std::string number = std::to_string(i + 1);
    app.name = std::string(first) + second + number;
    app.identifier = kIdentifierPrefix + lowercase(app.name);
    app.displayName = std::string(first) + " " + second + " " + number;
    if (i % 4 == 1) app.displayName += " \u00dcberall \u2726";
    const uint64_t major = random_.between(1, 4), minor = random_.between(0, 20), patch = random_.between(0, 9);
    app.version = std::to_string(major) + "." + std::to_string(minor) + "." + std::to_string(patch);
    app.shortVersion = std::to_string(major) + "." + std::to_string(minor);
    app.hasDisplayName = i % 7 != 5;
    app.hasShortVersion = i % 5 != 2;
    app.binaryInfoPlist = i % 4 == 3;
    app.iconSize = kIconSizes[random_.between(0, std::size(kIconSizes) - 1)];
    app.hue = static_cast<int>(random_.between(0, 359));
    app.uuid = random_.uuid();
  }

  static uint64_t majorVersion(const std::string& version) { return std::stoull(version.substr(0, version.find('.'))); }

  // Every sixth regular application carries a VPN plug-in, and at least as
  // many as there are VPN-only containers, each of which needs a plug-in of
  // its own to share an identifier with.
  void planPlugins() {
    const size_t carriers = std::min(regular_.size(), std::max<size_t>(options_.vpnOnly, (regular_.size() + 5) / 6));
    for (size_t k = 0; k < carriers; ++k) {
      AppPlan& app = *regular_[k];
      app.pluginName = app.name + kPluginSuffix;
      app.pluginIdentifier = app.identifier + kPluginIdentifierSuffix;
    }
    for (size_t k = 0; k < options_.vpnOnly; ++k) vpnOnly_.push_back({random_.uuid(), regular_[k]});
  }

  // Group sizes cycle through 3, 1, 2 members: some groups are shared by
  // several applications, which must be moved once.
  void planGroups() {
    size_t cursor = 0;
    for (size_t g = 0; g < options_.groups; ++g) {
      GroupPlan group{kGroupIdentifierPrefix + std::to_string(g + 1), random_.uuid(), {}};
      static constexpr size_t kSizes[] = {3, 1, 2};
      const size_t size = std::min(kSizes[g % std::size(kSizes)], regular_.size());
      for (size_t m = 0; m < size; ++m) {
        AppPlan& app = *regular_[cursor++ % regular_.size()];
        app.groups.push_back(group.identifier);
        group.members.push_back(app.identifier);
      }
      groups_.push_back(std::move(group));
    }
  }

  void planStoreMetadata(AppPlan& app) {
    switch (random_.between(0, 2)) {
      case 0:
        app.storeMetadata = AppPlan::StoreMetadata::None;
        break;
      case 1:
        app.storeMetadata = AppPlan::StoreMetadata::MetadataOnly;
        break;
      default:
        app.storeMetadata = AppPlan::StoreMetadata::All;
        break;
    }
  }

  // --- Writing.

  bool makeDirectories(std::string* why) {
    for (const std::string& dir :
         {layout_.oldApplicationsDirectory(), layout_.dataDirectory(), layout_.systemApplicationsDirectory(),
          layout_.oldGroupContainersDirectory(), layout_.safeHarborsDirectory(),
          platform::URL::fileURL(layout_.installMap()).deletingLastPathComponent().path(),
          platform::URL::fileURL(layout_.systemVersionFile()).deletingLastPathComponent().path()}) {
      if (!devicegen::makeDirectories(dir, why)) return false;
    }
    return true;
  }

  bool writeSystemVersion(std::string* why) {
    const uint64_t major = random_.between(10, 19);
    const std::string build = std::to_string(major) + static_cast<char>('A' + random_.between(0, 5)) +
                              std::to_string(random_.between(100, 999));
    manifest_.systemVersion = Dictionary{{platform::kSystemVersionBuildVersionKey, build},
                                         {platform::kSystemVersionProductVersionKey,
                                          std::to_string(major) + "." + std::to_string(random_.between(0, 4))},
                                         {platform::kSystemVersionProductNameKey, kProductName}};
    return writePlist(manifest_.systemVersion, layout_.systemVersionFile(), platform::plist::Format::XML, why);
  }

  bool writeBuiltIns(std::string* why) {
    for (const PlainBuiltIn& b : kPlainBuiltIns) {
      Dictionary info = bundleInfo(b.identifier, b.name, b.name, b.version, b.version);
      if (b.noDataContainer) info[platform::kNoDataContainerKey] = true;
      if (!writeBuiltIn(b.name, b.identifier, b.version, info, b.noDataContainer, why)) return false;
    }
    for (const AppPlan& app : apps_) {
      if (app.role != Role::BuiltInOlder) continue;
      const Dictionary info =
          bundleInfo(app.identifier, app.displayName, app.name, app.builtInVersion, app.shortVersion);
      if (!writeBuiltIn(app.name, app.identifier, app.builtInVersion, info, false, why)) return false;
    }
    return true;
  }

  bool writeBuiltIn(const std::string& name, const std::string& identifier, const std::string& version,
                    const Dictionary& info, bool noDataContainer, std::string* why) {
    const std::string bundle = join(layout_.systemApplicationsDirectory(), name + "." + platform::kApplicationBundleExtension);
    manifest_.builtIns.push_back({identifier, layout_.relative(bundle), version, noDataContainer});
    const int hue = static_cast<int>(random_.between(0, 359));
    return devicegen::makeDirectories(bundle, why) &&
           writePlist(info, join(bundle, platform::kInfoPlistFileName), platform::plist::Format::XML, why) &&
           writeExecutable(join(bundle, name), why) && writeIcon(bundle, kIconSizes[0], hue, why);
  }

  bool writeApplications(std::string* why) {
    for (const AppPlan& app : apps_) {
      const std::string container = join(layout_.oldApplicationsDirectory(), app.uuid);
      const std::string bundle = join(container, app.name + "." + platform::kApplicationBundleExtension);
      if (!devicegen::makeDirectories(bundle, why) || !writeApplicationBundle(app, bundle, why)) return false;
      if (!app.pluginName.empty() &&
          !writePlugin(app, join(container, app.pluginName + "." + platform::kVPNPluginBundleExtension), why)) {
        return false;
      }
      if (!writeStoreMetadata(app, container, why)) return false;
      if (!writeTree(container, ManifestItem::Owner::Application, app.identifier, applicationDataShape(),
                     app.invalidUTF8Name, why)) {
        return false;
      }
      ManifestContainer entry;
      entry.identifier = app.identifier;
      entry.containerPath = layout_.relative(container);
      entry.bundleName = app.name + "." + platform::kApplicationBundleExtension;
      entry.version = app.version;
      entry.placeholder = app.role == Role::Placeholder;
      entry.builtInRefusal = app.role == Role::BuiltInOlder;
      entry.vpnPluginIdentifier = app.pluginIdentifier;
      entry.groups = app.groups;
      entry.storeMetadata = app.storeMetadata != AppPlan::StoreMetadata::None;
      manifest_.containers.push_back(std::move(entry));
    }
    return true;
  }

  bool writeApplicationBundle(const AppPlan& app, const std::string& bundle, std::string* why) {
    Dictionary info = bundleInfo(app.identifier, app.hasDisplayName ? app.displayName : "", app.name, app.version,
                                 app.hasShortVersion ? app.shortVersion : "");
    if (!app.groups.empty()) {
      platform::Array groups;
      for (const auto& g : app.groups) groups.emplace_back(g);
      info[platform::kApplicationGroupsKey] = std::move(groups);
    }
    const auto format = app.binaryInfoPlist ? platform::plist::Format::Binary : platform::plist::Format::XML;
    if (!writePlist(info, join(bundle, platform::kInfoPlistFileName), format, why) ||
        !writeIcon(bundle, app.iconSize, app.hue, why)) {
      return false;
    }
    // A placeholder bundle is what the registry would have installed in the
    // application's stead: an Info.plist and an icon, marked.
    if (app.role != Role::Placeholder) return writeExecutable(join(bundle, app.name), why);
    platform::Error error;
    if (!QSFileManager::defaultManager().markBundleAsPlaceholder(platform::URL::fileURL(bundle, true), &error)) {
      if (why) *why = "cannot mark " + bundle + " as a placeholder: " + error.description();
      return false;
    }
    return true;
  }

  bool writePlugin(const AppPlan& app, const std::string& bundle, std::string* why) {
    const Dictionary info = bundleInfo(app.pluginIdentifier, app.displayName + " VPN", app.pluginName, app.version, "");
    return devicegen::makeDirectories(bundle, why) &&
           writePlist(info, join(bundle, platform::kInfoPlistFileName), platform::plist::Format::XML, why) &&
           writeExecutable(join(bundle, app.pluginName), why);
  }

  bool writeStoreMetadata(const AppPlan& app, const std::string& container, std::string* why) {
    if (app.storeMetadata == AppPlan::StoreMetadata::None) return true;
    const Dictionary metadata{{"itemId", Value(static_cast<unsigned long long>(100000 + app.index))},
                              {"itemName", app.displayName},
                              {"bundleVersion", app.version},
                              {"artistName", "Example Developer"}};
    if (!writePlist(metadata, join(container, kQSStoreMetadataItemName), platform::plist::Format::XML, why)) return false;
    if (app.storeMetadata == AppPlan::StoreMetadata::MetadataOnly) return true;
    std::vector<uint8_t>& artwork = buffer(kArtworkBytes);
    random_.fill(artwork.data(), kArtworkBytes);
    const Dictionary packageManifest{{"Identifier", app.identifier}, {"Version", app.version}};
    return writePlist(packageManifest, join(container, kQSStoreManifestItemName), platform::plist::Format::XML, why) &&
           writeWholeFile(join(container, kQSStoreArtworkItemName), artwork.data(), kArtworkBytes, kFileMode, why) &&
           writeWholeFile(join(container, kQSStoreGeoJSONItemName), kGeoJSONDocument, sizeof kGeoJSONDocument - 1,
                          kFileMode, why);
  }

  bool writeVPNOnlyContainers(std::string* why) {
    for (const VPNOnlyPlan& plan : vpnOnly_) {
      const AppPlan& carrier = *plan.carrier;
      const std::string container = join(layout_.oldApplicationsDirectory(), plan.uuid);
      const std::string bundleName = carrier.pluginName + "." + platform::kVPNPluginBundleExtension;
      if (!writePlugin(carrier, join(container, bundleName), why) ||
          !writeTree(container, ManifestItem::Owner::Application, carrier.pluginIdentifier, applicationDataShape(),
                     false, why)) {
        return false;
      }
      ManifestContainer entry;
      entry.kind = ManifestContainer::Kind::VPNOnly;
      entry.identifier = carrier.pluginIdentifier;
      entry.containerPath = layout_.relative(container);
      entry.bundleName = bundleName;
      entry.version = carrier.version;
      manifest_.containers.push_back(std::move(entry));
    }
    return true;
  }

  bool writeGroups(std::string* why) {
    for (const GroupPlan& group : groups_) {
      const std::string container = join(layout_.oldGroupContainersDirectory(), group.uuid);
      if (!devicegen::makeDirectories(container, why) ||
          !writeTree(container, ManifestItem::Owner::Group, group.identifier, groupDataShape(), false, why)) {
        return false;
      }
      manifest_.groups.push_back({group.identifier, layout_.relative(container), group.members});
    }
    return true;
  }

  bool writeOldApplicationsNote(std::string* why) {
    return writeWholeFile(join(layout_.oldApplicationsDirectory(), kQSOldApplicationsNoteFileName), kOldApplicationsNote,
                          sizeof kOldApplicationsNote - 1, kFileMode, why);
  }

  bool writeInstallMap(std::string* why) {
    Dictionary groups, users;
    for (const ManifestGroup& group : manifest_.groups) {
      groups[group.identifier] = Dictionary{{kQSGroupContainerPathKey, layout_.absolute(group.containerPath)}};
    }
    for (const ManifestContainer& c : manifest_.containers) {
      if (c.kind == ManifestContainer::Kind::Application) {
        users[c.identifier] = Dictionary{{kQSGroupContainerPathKey, layout_.absolute(c.containerPath)}};
      }
    }
    const Dictionary map{{kQSInstallMapGroupContainersKey, std::move(groups)}, {kInstallMapUserKey, std::move(users)}};
    return writePlist(map, layout_.installMap(), platform::plist::Format::XML, why);
  }

  bool writeSafeHarbors(std::string* why) {
    if (options_.harbors == 0) return true;
    Dictionary map;
    for (uint64_t k = 1; k <= options_.harbors; ++k) {
      const std::string identifier = kRetiredIdentifierPrefix + std::to_string(k);
      const std::string directory = join(layout_.safeHarborsDirectory(), identifier);
      const std::string kept = join(directory, kHarborKeptFile);
      if (!devicegen::makeDirectories(platform::URL::fileURL(kept).deletingLastPathComponent().path(), why) ||
          !writeWholeFile(kept, kHarborKeptText, sizeof kHarborKeptText - 1, kFileMode, why)) {
        return false;
      }
      map[identifier] = Dictionary{{kQSHarborPathKey, directory}};
      manifest_.harbors.push_back({identifier, layout_.relative(directory)});
    }
    return writePlist(map, layout_.safeHarborMap(), platform::plist::Format::XML, why);
  }

  // --- User data trees.

  bool writeTree(const std::string& container, ManifestItem::Owner owner, const std::string& ownerId,
                 const TreeShape& shape, bool invalidUTF8Name, std::string* why) {
    std::vector<std::string> made;
    auto directory = [&](const std::string& relative) {
      for (size_t slash = 0; slash != std::string::npos;) {
        slash = relative.find('/', slash + 1);
        const std::string prefix = relative.substr(0, slash);
        if (std::find(made.begin(), made.end(), prefix) != made.end()) continue;
        if (!devicegen::makeDirectories(join(container, prefix), why)) return false;
        made.push_back(prefix);
        addItem(owner, ownerId, ManifestItem::Kind::Directory, prefix);
      }
      return true;
    };
    for (const char* dir : shape.directories) {
      if (!directory(dir)) return false;
    }
    for (const char* dir : shape.emptyDirectories) {
      if (!directory(dir)) return false;
    }
    for (uint64_t k = 0; k < options_.filesPerApp; ++k) {
      const Slot& slot = shape.slots[k % shape.slots.size()];
      const std::string relative =
          std::string(slot.directory) + "/" + slot.prefix + std::to_string(k / shape.slots.size() + 1) + slot.suffix;
      if (!directory(slot.directory) || !writeRandomFile(container, owner, ownerId, relative, fileSize(k), why)) {
        return false;
      }
    }
    if (invalidUTF8Name &&
        !writeRandomFile(container, owner, ownerId, std::string("Documents/") + kInvalidUTF8Name, fileSize(1), why)) {
      return false;
    }
    return writePreferences(container, owner, ownerId, shape, why) &&
           writeBytes(container, owner, ownerId, shape.emptyFile, nullptr, 0, why) &&
           writeLinks(container, owner, ownerId, shape, why);
  }

  uint64_t fileSize(uint64_t k) {
    const uint64_t b = options_.bytesPerFile;
    const uint64_t size = b == 0 ? 0 : random_.between(b / 2, b + b / 2);
    // Now and then a file several times larger, so that copies and hashes
    // see more than one chunk.
    return k % 13 == 12 ? size * 8 : size;
  }

  bool writeRandomFile(const std::string& container, ManifestItem::Owner owner, const std::string& ownerId,
                       const std::string& relative, uint64_t size, std::string* why) {
    std::vector<uint8_t>& bytes = buffer(size);
    random_.fill(bytes.data(), size);
    return writeBytes(container, owner, ownerId, relative, bytes.data(), size, why);
  }

  bool writePreferences(const std::string& container, ManifestItem::Owner owner, const std::string& ownerId,
                        const TreeShape& shape, std::string* why) {
    const Dictionary preferences{{"LaunchCount", Value(static_cast<unsigned long long>(random_.between(1, 500)))},
                                 {"Theme", random_.chance(1, 2) ? "dark" : "light"},
                                 {"UserName", "Ada"}};
    platform::Error error;
    const std::optional<platform::Data> bytes =
        platform::plist::serialize(preferences, platform::plist::Format::XML, &error);
    if (!bytes) {
      if (why) *why = "cannot serialise preferences: " + error.description();
      return false;
    }
    const std::string relative = std::string(shape.preferencesDirectory) + "/" + ownerId + ".plist";
    return writeBytes(container, owner, ownerId, relative, bytes->data(), bytes->size(), why);
  }

  bool writeLinks(const std::string& container, ManifestItem::Owner owner, const std::string& ownerId,
                  const TreeShape& shape, std::string* why) {
    for (const auto& [path, target] : shape.links) {
      if (!makeSymlink(target, join(container, path), why)) return false;
      ManifestItem& item = addItem(owner, ownerId, ManifestItem::Kind::Link, path);
      item.linkTarget = target;
    }
    return true;
  }

  bool writeBytes(const std::string& container, ManifestItem::Owner owner, const std::string& ownerId,
                  const std::string& relative, const uint8_t* bytes, size_t size, std::string* why) {
    if (!writeWholeFile(join(container, relative), bytes, size, kFileMode, why)) return false;
    ManifestItem& item = addItem(owner, ownerId, ManifestItem::Kind::File, relative);
    item.size = size;
    item.digest = platform::sha256(bytes, size);
    return true;
  }

  ManifestItem& addItem(ManifestItem::Owner owner, const std::string& ownerId, ManifestItem::Kind kind,
                        const std::string& relative) {
    ManifestItem item;
    item.owner = owner;
    item.kind = kind;
    item.ownerIdentifier = ownerId;
    item.path = relative;
    manifest_.items.push_back(std::move(item));
    return manifest_.items.back();
  }

  // --- Small writers.

  static Dictionary bundleInfo(const std::string& identifier, const std::string& displayName,
                               const std::string& executable, const std::string& version,
                               const std::string& shortVersion) {
    Dictionary info{{platform::kBundleIdentifierKey, identifier},
                    {platform::kBundleExecutableKey, executable},
                    {platform::kBundleVersionKey, version},
                    {platform::kBundleIconFileKey, platform::kDefaultIconFileName}};
    if (!displayName.empty()) info[platform::kBundleDisplayNameKey] = displayName;
    if (!shortVersion.empty()) info[platform::kBundleShortVersionStringKey] = shortVersion;
    return info;
  }

  bool writeIcon(const std::string& bundle, int size, int hue, std::string* why) {
    const std::optional<std::vector<uint8_t>> png = encodeIcon(size, hue, why);
    return png &&
           writeWholeFile(join(bundle, platform::kDefaultIconFileName), png->data(), png->size(), kFileMode, why);
  }

  static bool writeExecutable(const std::string& path, std::string* why) {
    return writeWholeFile(path, kExecutableScript, sizeof kExecutableScript - 1, kExecutableMode, why);
  }

  // Image files are written plainly, not atomically: a half-made image is
  // thrown away anyway, and per-file fsync would make large images slow.
  static bool writePlist(const Dictionary& value, const std::string& path, platform::plist::Format format,
                         std::string* why) {
    platform::Error error;
    if (!platform::plist::writeFile(value, platform::URL::fileURL(path), format, /*atomically=*/false, &error)) {
      if (why) *why = "cannot write " + path + ": " + error.description();
      return false;
    }
    return true;
  }

  std::vector<uint8_t>& buffer(size_t size) {
    if (buffer_.size() < size) buffer_.resize(size);
    return buffer_;
  }

  const ImageOptions& options_;
  DeviceLayout layout_;
  DeterministicRandom random_;
  Manifest& manifest_;
  std::vector<AppPlan> apps_;
  std::vector<AppPlan*> regular_;  // by index
  std::vector<VPNOnlyPlan> vpnOnly_;
  std::vector<GroupPlan> groups_;
  std::vector<uint8_t> buffer_;  // reused for every generated file
};

}  // namespace

std::string checkImageOptions(const ImageOptions& o) {
  if (o.applications > kMaximumApplications) return "--apps is limited to " + std::to_string(kMaximumApplications);
  if (o.filesPerApp > kMaximumFilesPerApp) {
    return "--files-per-app is limited to " + std::to_string(kMaximumFilesPerApp);
  }
  if (o.bytesPerFile > kMaximumBytesPerFile) {
    return "--bytes-per-file is limited to " + std::to_string(kMaximumBytesPerFile);
  }
  if (o.placeholders + o.builtInOlder > o.applications) {
    return "--placeholders plus --builtin-older (" + std::to_string(o.placeholders + o.builtInOlder) +
           ") exceeds --apps (" + std::to_string(o.applications) + ")";
  }
  const uint64_t regular = o.applications - o.placeholders - o.builtInOlder;
  if (o.vpnOnly > regular) {
    return "--vpn-only (" + std::to_string(o.vpnOnly) +
           ") needs as many ordinary applications to carry the plug-ins (" + std::to_string(regular) + " available)";
  }
  if (o.groups > 0 && regular == 0) return "--groups needs at least one ordinary application";
  return "";
}

bool createImage(const ImageOptions& options, Manifest* manifest, std::string* why) {
  ImageWriter writer(options, manifest);
  return writer.write(why);
}

}  // namespace devicegen
