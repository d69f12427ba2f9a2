#include "Tools/devicegen/Manifest.h"

#include "Platform/Foundation/PropertyList.h"
#include "Platform/Foundation/Text.h"
#include "Platform/Foundation/URL.h"

namespace devicegen {
namespace {

using platform::Array;
using platform::Dictionary;
using platform::Value;

// The manifest lists every item of the image, about 9 KB per application,
// so it outgrows the property-list reader's default limit (meant for files
// of unknown origin) at about 3,500 applications. It is devicegen's own
// file; this limit covers 100,000 applications.
constexpr size_t kManifestFileSizeLimit = size_t{1} << 30;
constexpr char kFormatVersionKey[] = "FormatVersion";
constexpr char kSeedKey[] = "Seed";
constexpr char kSystemVersionKey[] = "SystemVersion";
constexpr char kContainersKey[] = "Containers";
constexpr char kGroupsKey[] = "Groups";
constexpr char kSafeHarborsKey[] = "SafeHarbors";
constexpr char kBuiltInsKey[] = "BuiltInApplications";
constexpr char kItemsKey[] = "Items";
constexpr char kTotalsKey[] = "Totals";
constexpr char kFilesKey[] = "Files";
constexpr char kBytesKey[] = "Bytes";

constexpr char kKindKey[] = "Kind";
constexpr char kIdentifierKey[] = "Identifier";
constexpr char kContainerKey[] = "Container";
constexpr char kBundleKey[] = "Bundle";
constexpr char kVersionKey[] = "Version";
constexpr char kPlaceholderKey[] = "Placeholder";
constexpr char kBuiltInRefusalKey[] = "BuiltInRefusal";
constexpr char kVPNPluginIdentifierKey[] = "VPNPluginIdentifier";
constexpr char kStoreMetadataKey[] = "StoreMetadata";
constexpr char kMembersKey[] = "Members";
constexpr char kPathKey[] = "Path";
constexpr char kNoDataContainerKey[] = "NoDataContainer";
constexpr char kOwnerKey[] = "Owner";
constexpr char kSizeKey[] = "Size";
constexpr char kDigestKey[] = "SHA256";
constexpr char kLinkTargetKey[] = "LinkTarget";
// A name that is not UTF-8 cannot be a property-list string; it is kept as
// data under the key with this suffix.
constexpr char kBytesSuffix[] = "Bytes";

constexpr char kKindApplication[] = "App";
constexpr char kKindVPNOnly[] = "VPNOnly";
constexpr char kOwnerGroup[] = "Group";
constexpr char kItemFile[] = "File";
constexpr char kItemDirectory[] = "Directory";
constexpr char kItemLink[] = "Link";

void putBytes(Dictionary& d, const std::string& key, const std::string& bytes) {
  if (platform::isValidUTF8(bytes)) {
    d[key] = Value(bytes);
  } else {
    d[key + kBytesSuffix] = Value(platform::Data(bytes.begin(), bytes.end()));
  }
}

Array stringArray(const std::vector<std::string>& items) {
  Array array;
  array.reserve(items.size());
  for (const auto& item : items) array.emplace_back(item);
  return array;
}

Value containerValue(const ManifestContainer& c) {
  Dictionary d;
  d[kKindKey] = c.kind == ManifestContainer::Kind::Application ? kKindApplication : kKindVPNOnly;
  d[kIdentifierKey] = c.identifier;
  d[kContainerKey] = c.containerPath;
  d[kBundleKey] = c.bundleName;
  d[kVersionKey] = c.version;
  d[kPlaceholderKey] = c.placeholder;
  d[kBuiltInRefusalKey] = c.builtInRefusal;
  if (!c.vpnPluginIdentifier.empty()) d[kVPNPluginIdentifierKey] = c.vpnPluginIdentifier;
  d[kGroupsKey] = stringArray(c.groups);
  d[kStoreMetadataKey] = c.storeMetadata;
  return d;
}

Value itemValue(const ManifestItem& item) {
  Dictionary d;
  d[kOwnerKey] = item.owner == ManifestItem::Owner::Application ? kKindApplication : kOwnerGroup;
  d[kIdentifierKey] = item.ownerIdentifier;
  putBytes(d, kPathKey, item.path);
  switch (item.kind) {
    case ManifestItem::Kind::File:
      d[kKindKey] = kItemFile;
      d[kSizeKey] = Value(static_cast<unsigned long long>(item.size));
      d[kDigestKey] = platform::hexString(item.digest.data(), item.digest.size());
      break;
    case ManifestItem::Kind::Directory:
      d[kKindKey] = kItemDirectory;
      break;
    case ManifestItem::Kind::Link:
      d[kKindKey] = kItemLink;
      putBytes(d, kLinkTargetKey, item.linkTarget);
      break;
  }
  return d;
}

// Reads fields of one dictionary of the manifest; the first problem is kept
// and makes every later read a no-op.
class FieldReader {
 public:
  FieldReader(const Value& value, std::string where, std::string* why)
      : value_(value), where_(std::move(where)), why_(why) {
    if (!value.isDictionary()) fail("is not a dictionary");
  }
  bool ok() const { return ok_; }

  std::string string(const char* key) {
    const Value* v = lookup(key);
    if (v && !v->isString()) fail(std::string(key) + " is not a string");
    return ok_ && v ? *v->asString() : std::string();
  }
  // A string that may have been stored as data (see putBytes).
  std::string bytes(const char* key) {
    if (!ok_) return {};
    if (const Value* v = value_.get(std::string(key) + kBytesSuffix)) {
      if (const platform::Data* data = v->asData()) return std::string(data->begin(), data->end());
      fail(std::string(key) + kBytesSuffix + " is not data");
      return {};
    }
    return string(key);
  }
  std::string optionalString(const char* key) { return ok_ && value_.get(key) ? string(key) : std::string(); }
  bool boolean(const char* key) {
    const Value* v = lookup(key);
    if (v && !v->isBoolean()) fail(std::string(key) + " is not a boolean");
    return ok_ && v && v->boolValue();
  }
  uint64_t unsignedInteger(const char* key) {
    const Value* v = lookup(key);
    if (v && !v->isInteger()) fail(std::string(key) + " is not an integer");
    return ok_ && v ? v->uint64Value() : 0;
  }
  std::vector<std::string> strings(const char* key) {
    std::vector<std::string> result;
    const Value* v = lookup(key);
    if (!v) return result;
    const Array* array = v->asArray();
    if (!array) {
      fail(std::string(key) + " is not an array");
      return result;
    }
    for (const Value& item : *array) {
      if (!item.isString()) {
        fail(std::string(key) + " holds a non-string");
        return {};
      }
      result.push_back(*item.asString());
    }
    return result;
  }
  platform::SHA256Digest digest(const char* key) {
    platform::SHA256Digest digest{};
    const std::string hex = string(key);
    if (!ok_) return digest;
    if (hex.size() != digest.size() * 2) {
      fail(std::string(key) + " is not 64 hexadecimal digits");
      return digest;
    }
    for (size_t i = 0; i < digest.size(); ++i) {
      const int hi = hexValue(hex[2 * i]), lo = hexValue(hex[2 * i + 1]);
      if (hi < 0 || lo < 0) {
        fail(std::string(key) + " is not hexadecimal");
        return digest;
      }
      digest[i] = static_cast<uint8_t>(hi * 16 + lo);
    }
    return digest;
  }
  void fail(const std::string& what) {
    if (ok_ && why_) *why_ = where_ + ": " + what;
    ok_ = false;
  }

 private:
  const Value* lookup(const char* key) {
    if (!ok_) return nullptr;
    const Value* v = value_.get(key);
    if (!v) fail(std::string("no ") + key);
    return v;
  }
  static int hexValue(char c) {
    if (c >= '0' && c <= '9') return c - '0';
    if (c >= 'a' && c <= 'f') return c - 'a' + 10;
    if (c >= 'A' && c <= 'F') return c - 'A' + 10;
    return -1;
  }

  const Value& value_;
  std::string where_;
  std::string* why_;
  bool ok_ = true;
};

template <class T, class Parse>
bool readList(const Dictionary& root, const char* key, std::vector<T>* out, std::string* why, Parse parse) {
  const Value* v = root.count(key) ? &root.find(key)->second : nullptr;
  const Array* array = v ? v->asArray() : nullptr;
  if (!array) {
    if (why) *why = std::string("manifest: ") + key + " is missing or not an array";
    return false;
  }
  out->reserve(array->size());
  for (size_t i = 0; i < array->size(); ++i) {
    FieldReader r((*array)[i], std::string(key) + "[" + std::to_string(i) + "]", why);
    T item = parse(r);
    if (!r.ok()) return false;
    out->push_back(std::move(item));
  }
  return true;
}

ManifestContainer parseContainer(FieldReader& r) {
  ManifestContainer c;
  const std::string kind = r.string(kKindKey);
  if (kind == kKindVPNOnly) {
    c.kind = ManifestContainer::Kind::VPNOnly;
  } else if (kind != kKindApplication && r.ok()) {
    r.fail("unknown Kind \"" + kind + "\"");
  }
  c.identifier = r.string(kIdentifierKey);
  c.containerPath = r.string(kContainerKey);
  c.bundleName = r.string(kBundleKey);
  c.version = r.string(kVersionKey);
  c.placeholder = r.boolean(kPlaceholderKey);
  c.builtInRefusal = r.boolean(kBuiltInRefusalKey);
  c.vpnPluginIdentifier = r.optionalString(kVPNPluginIdentifierKey);
  c.groups = r.strings(kGroupsKey);
  c.storeMetadata = r.boolean(kStoreMetadataKey);
  return c;
}

ManifestItem parseItem(FieldReader& r) {
  ManifestItem item;
  const std::string owner = r.string(kOwnerKey);
  if (owner == kOwnerGroup) {
    item.owner = ManifestItem::Owner::Group;
  } else if (owner != kKindApplication && r.ok()) {
    r.fail("unknown Owner \"" + owner + "\"");
  }
  item.ownerIdentifier = r.string(kIdentifierKey);
  item.path = r.bytes(kPathKey);
  const std::string kind = r.string(kKindKey);
  if (kind == kItemFile) {
    item.kind = ManifestItem::Kind::File;
    item.size = r.unsignedInteger(kSizeKey);
    item.digest = r.digest(kDigestKey);
  } else if (kind == kItemDirectory) {
    item.kind = ManifestItem::Kind::Directory;
  } else if (kind == kItemLink) {
    item.kind = ManifestItem::Kind::Link;
    item.linkTarget = r.bytes(kLinkTargetKey);
  } else if (r.ok()) {
    r.fail("unknown Kind \"" + kind + "\"");
  }
  if (r.ok() && (item.path.empty() || item.path.front() == '/')) r.fail("Path is not relative");
  return item;
}

}  // namespace

uint64_t Manifest::fileCount() const {
  uint64_t count = 0;
  for (const auto& item : items) count += item.kind == ManifestItem::Kind::File;
  return count;
}

uint64_t Manifest::byteCount() const {
  uint64_t bytes = 0;
  for (const auto& item : items) bytes += item.kind == ManifestItem::Kind::File ? item.size : 0;
  return bytes;
}

Value manifestToValue(const Manifest& m) {
  Dictionary root;
  root[kFormatVersionKey] = Value(static_cast<long long>(kManifestFormatVersion));
  root[kSeedKey] = Value(static_cast<unsigned long long>(m.seed));
  root[kSystemVersionKey] = m.systemVersion;
  Array containers, groups, harbors, builtIns, items;
  for (const auto& c : m.containers) containers.push_back(containerValue(c));
  for (const auto& g : m.groups) {
    groups.push_back(Dictionary{
        {kIdentifierKey, g.identifier}, {kContainerKey, g.containerPath}, {kMembersKey, stringArray(g.members)}});
  }
  for (const auto& h : m.harbors) harbors.push_back(Dictionary{{kIdentifierKey, h.identifier}, {kPathKey, h.path}});
  for (const auto& b : m.builtIns) {
    builtIns.push_back(Dictionary{{kIdentifierKey, b.identifier},
                                  {kBundleKey, b.bundlePath},
                                  {kVersionKey, b.version},
                                  {kNoDataContainerKey, b.noDataContainer}});
  }
  items.reserve(m.items.size());
  for (const auto& item : m.items) items.push_back(itemValue(item));
  root[kContainersKey] = std::move(containers);
  root[kGroupsKey] = std::move(groups);
  root[kSafeHarborsKey] = std::move(harbors);
  root[kBuiltInsKey] = std::move(builtIns);
  root[kItemsKey] = std::move(items);
  root[kTotalsKey] = Dictionary{{kFilesKey, Value(static_cast<unsigned long long>(m.fileCount()))},
                                {kBytesKey, Value(static_cast<unsigned long long>(m.byteCount()))}};
  return root;
}

std::optional<Manifest> manifestFromValue(const Value& value, std::string* why) {
  const Dictionary* root = value.asDictionary();
  if (!root) {
    if (why) *why = "manifest: the root is not a dictionary";
    return std::nullopt;
  }
  FieldReader top(value, "manifest", why);
  Manifest m;
  if (top.unsignedInteger(kFormatVersionKey) != static_cast<uint64_t>(kManifestFormatVersion) && top.ok()) {
    top.fail("unsupported FormatVersion");
  }
  m.seed = top.unsignedInteger(kSeedKey);
  if (!top.ok()) return std::nullopt;
  const Value* systemVersion = value.get(kSystemVersionKey);
  if (!systemVersion || !systemVersion->isDictionary()) {
    if (why) *why = "manifest: SystemVersion is missing or not a dictionary";
    return std::nullopt;
  }
  m.systemVersion = *systemVersion->asDictionary();
  const bool ok =
      readList(*root, kContainersKey, &m.containers, why, parseContainer) &&
      readList(*root, kGroupsKey, &m.groups, why,
               [](FieldReader& r) {
                 return ManifestGroup{r.string(kIdentifierKey), r.string(kContainerKey), r.strings(kMembersKey)};
               }) &&
      readList(*root, kSafeHarborsKey, &m.harbors, why,
               [](FieldReader& r) {
                 return ManifestHarbor{r.string(kIdentifierKey), r.string(kPathKey)};
               }) &&
      readList(*root, kBuiltInsKey, &m.builtIns, why,
               [](FieldReader& r) {
                 return ManifestBuiltIn{r.string(kIdentifierKey), r.string(kBundleKey), r.string(kVersionKey),
                                        r.boolean(kNoDataContainerKey)};
               }) &&
      readList(*root, kItemsKey, &m.items, why, parseItem);
  if (!ok) return std::nullopt;
  return m;
}

bool writeManifest(const Manifest& manifest, const std::string& path, std::string* why) {
  platform::Error error;
  if (!platform::plist::writeFile(manifestToValue(manifest), platform::URL::fileURL(path), platform::plist::Format::XML,
                                  /*atomically=*/true, &error)) {
    if (why) *why = "cannot write the manifest " + path + ": " + error.description();
    return false;
  }
  return true;
}

std::optional<Manifest> readManifest(const std::string& path, std::string* why) {
  platform::Error error;
  std::optional<Value> value = platform::plist::readFile(
      platform::URL::fileURL(path), platform::plist::ReadOptions{.sizeLimit = kManifestFileSizeLimit}, &error);
  if (!value) {
    if (why) *why = "cannot read the manifest " + path + ": " + error.description();
    return std::nullopt;
  }
  return manifestFromValue(*value, why);
}

}  // namespace devicegen
