#include "Tools/appregistry/RecordFormat.h"

#include <algorithm>

#include "Platform/Foundation/Json.h"
#include "Platform/Foundation/Text.h"

namespace appregistry {
namespace {

using platform::BundleRecord;
using platform::JsonWriter;
using platform::SafeHarborRecord;

constexpr char kNone[] = "-";
constexpr char kColumnGap[] = "  ";

std::string yesNo(bool value) {
  return value ? "yes" : "no";
}

// Rows of cells, rendered with every column as wide as its widest cell. The
// last column is not padded.
class TextTable {
 public:
  void add(std::vector<std::string> cells) {
    for (auto& cell : cells) cell = platform::printable(cell);
    rows_.push_back(std::move(cells));
  }
  std::string render() const {
    std::vector<size_t> widths;
    for (const auto& row : rows_) {
      widths.resize(std::max(widths.size(), row.size()));
      for (size_t c = 0; c < row.size(); ++c) widths[c] = std::max(widths[c], platform::displayColumns(row[c]));
    }
    std::string out;
    for (const auto& row : rows_) {
      std::string line;
      for (size_t c = 0; c < row.size(); ++c) {
        line += row[c];
        if (c + 1 < row.size()) line += std::string(widths[c] - platform::displayColumns(row[c]), ' ') + kColumnGap;
      }
      out += line + "\n";
    }
    return out;
  }

 private:
  std::vector<std::vector<std::string>> rows_;
};

std::string optionalPath(const std::optional<platform::URL>& url) {
  return url ? url->path() : kNone;
}

std::string groupCount(const BundleRecord& r) {
  return r.groupContainerURLs ? std::to_string(r.groupContainerURLs->size()) : kNone;
}

void writeRecord(JsonWriter& json, const BundleRecord& r) {
  json.beginObject();
  json.key("identifier").string(r.identifier);
  json.key("bundleType").string(r.bundleType);
  json.key("version").string(r.version);
  json.key("displayName").string(r.displayName);
  json.key("placeholder").boolean(r.isPlaceholder);
  json.key("foundBackingBundle").boolean(r.foundBackingBundle);
  json.key("bundlePath").string(r.bundleURL.path());
  json.key("bundleContainerPath").string(r.bundleContainerURL.path());
  json.key("dataContainerPath");
  if (r.dataContainerURL) {
    json.string(r.dataContainerURL->path());
  } else {
    json.null();
  }
  json.key("groupContainers");
  if (r.groupContainerURLs) {
    json.beginObject();
    for (const auto& [group, url] : *r.groupContainerURLs) json.key(group).string(url.path());
    json.endObject();
  } else {
    json.null();
  }
  json.endObject();
}

}  // namespace

std::string recordsTable(const std::vector<BundleRecord>& records, const std::vector<SafeHarborRecord>& harbors) {
  TextTable table;
  table.add({"IDENTIFIER", "TYPE", "VERSION", "PLACEHOLDER", "GROUPS", "DATA CONTAINER", "BUNDLE"});
  for (const BundleRecord& r : records) {
    table.add({r.identifier, r.bundleType, r.version.empty() ? kNone : r.version, yesNo(r.isPlaceholder), groupCount(r),
               optionalPath(r.dataContainerURL), r.bundleURL.path()});
  }
  std::string out = table.render();
  out += std::to_string(records.size()) + (records.size() == 1 ? " record\n" : " records\n");
  if (harbors.empty()) return out + "no safe harbors\n";
  TextTable harborTable;
  harborTable.add({"SAFE HARBOR", "CONTAINER TYPE", "PATH"});
  for (const SafeHarborRecord& h : harbors) harborTable.add({h.identifier, std::to_string(h.containerType), h.path});
  return out + "\n" + harborTable.render() + std::to_string(harbors.size()) +
         (harbors.size() == 1 ? " safe harbor\n" : " safe harbors\n");
}

std::string recordDetails(const BundleRecord& r) {
  TextTable table;
  table.add({"identifier:", r.identifier});
  table.add({"bundle type:", r.bundleType});
  table.add({"version:", r.version.empty() ? kNone : r.version});
  table.add({"display name:", r.displayName.empty() ? kNone : r.displayName});
  table.add({"placeholder:", yesNo(r.isPlaceholder)});
  table.add({"backing bundle:", r.foundBackingBundle ? "found" : "not found"});
  table.add({"bundle URL:", r.bundleURL.description()});
  table.add({"bundle container:", r.bundleContainerURL.empty() ? kNone : r.bundleContainerURL.description()});
  table.add({"data container:", r.dataContainerURL ? r.dataContainerURL->description() : kNone});
  if (!r.groupContainerURLs) {
    table.add({"group containers:", kNone});
  } else if (r.groupContainerURLs->empty()) {
    table.add({"group containers:", "none"});
  } else {
    bool first = true;
    for (const auto& [group, url] : *r.groupContainerURLs) {
      table.add({first ? "group containers:" : "", group + " " + url.description()});
      first = false;
    }
  }
  return table.render();
}

std::string recordsJson(const std::vector<BundleRecord>& records, const std::vector<SafeHarborRecord>& harbors) {
  JsonWriter json;
  json.beginObject().key("records").beginArray();
  for (const BundleRecord& r : records) writeRecord(json, r);
  json.endArray().key("safeHarbors").beginArray();
  for (const SafeHarborRecord& h : harbors) {
    json.beginObject();
    json.key("identifier").string(h.identifier);
    json.key("path").string(h.path);
    json.key("containerType").number(h.containerType);
    json.endObject();
  }
  json.endArray().endObject();
  return json.text() + "\n";
}

std::string recordJson(const BundleRecord& r) {
  JsonWriter json;
  writeRecord(json, r);
  return json.text() + "\n";
}

}  // namespace appregistry
