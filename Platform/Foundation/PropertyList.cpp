// Property lists through the libplist C API.
//
// libplist has one integer node type and keeps no sign for the nodes it
// creates: a node made from UINT64_MAX is written as -1. A node read from a
// document does remember that it held an unsigned value above INT64_MAX
// (that is the only difference plist_compare_node_value sees between it and
// a created node of the same bits). Reading therefore tells the two apart by
// comparison, and writing makes nodes for such values by reading them from a
// one-element document.
#include "Platform/Foundation/PropertyList.h"

#include <plist/plist.h>

#include <cmath>
#include <cstdint>
#include <cstdlib>
#include <memory>
#include <string>
#include <string_view>

#include "Platform/Foundation/FileErrors.h"
#include "Platform/Foundation/PropertyListCheck.h"
#include "Platform/Foundation/Text.h"

namespace platform::plist {

namespace {

using detail::kMaxNestingDepth;

constexpr std::string_view kUTF8ByteOrderMark = "\xEF\xBB\xBF";
constexpr std::string_view kBinaryMagic = "bplist";
// Keyed archives hold UIDs; they read as a dictionary with this one key, as
// in the XML form of such archives.
constexpr char kUIDKey[] = "CF$UID";
constexpr double kMicrosecondsPerSecond = 1e6;
// libplist's dates carry whole seconds in 32 bits.
constexpr double kEarliestDate = static_cast<double>(INT32_MIN);
constexpr double kLatestDate = static_cast<double>(INT32_MAX);

struct PlistFree {
  void operator()(void* node) const { plist_free(static_cast<plist_t>(node)); }
};
using PlistPtr = std::unique_ptr<void, PlistFree>;

struct MallocFree {
  void operator()(void* p) const { std::free(p); }
};
using MallocPtr = std::unique_ptr<char, MallocFree>;

struct XMLFree {
  void operator()(char* p) const { plist_to_xml_free(p); }
};
struct BinaryFree {
  void operator()(char* p) const { plist_to_bin_free(p); }
};

std::string_view formatName(Format format) { return format == Format::XML ? "XML" : "binary"; }

// ---- libplist nodes to Values ----

class NodeReader {
 public:
  std::optional<Value> read(plist_t node, int depth) {
    if (depth > kMaxNestingDepth) return fail("nesting deeper than " + std::to_string(kMaxNestingDepth) + " levels");
    switch (plist_get_node_type(node)) {
      case PLIST_BOOLEAN: {
        uint8_t b = 0;
        plist_get_bool_val(node, &b);
        return Value(b != 0);
      }
      case PLIST_UINT: return integer(node);
      case PLIST_REAL: {
        double d = 0;
        plist_get_real_val(node, &d);
        return Value(d);
      }
      case PLIST_STRING: {
        uint64_t length = 0;
        const char* text = plist_get_string_ptr(node, &length);
        return Value(std::string(text ? text : "", text ? length : 0));
      }
      case PLIST_KEY: {
        char* raw = nullptr;
        plist_get_key_val(node, &raw);
        MallocPtr key(raw);
        return Value(std::string(key ? key.get() : ""));
      }
      case PLIST_DATA: {
        uint64_t length = 0;
        const char* bytes = plist_get_data_ptr(node, &length);
        const uint8_t* begin = reinterpret_cast<const uint8_t*>(bytes);
        return Value(bytes ? Data(begin, begin + length) : Data());
      }
      case PLIST_DATE: return date(node);
      case PLIST_ARRAY: return array(node, depth);
      case PLIST_DICT: return dictionary(node, depth);
      case PLIST_UID: {
        uint64_t uid = 0;
        plist_get_uid_val(node, &uid);
        return Value(Dictionary{{kUIDKey, Value(uid)}});
      }
      default: return fail("an element of unknown type");
    }
  }

  const std::string& problem() const { return problem_; }

 private:
  std::optional<Value> fail(std::string problem) {
    if (problem_.empty()) problem_ = std::move(problem);
    return std::nullopt;
  }

  static Value integer(plist_t node) {
    uint64_t bits = 0;
    plist_get_uint_val(node, &bits);
    if (bits <= static_cast<uint64_t>(INT64_MAX)) return Value(static_cast<int64_t>(bits));
    PlistPtr created(plist_new_uint(bits));
    const bool createdAlike = plist_compare_node_value(node, created.get());
    return createdAlike ? Value(static_cast<int64_t>(bits)) : Value(bits);
  }

  static Value date(plist_t node) {
    // libplist splits the time into whole seconds rounded towards zero and
    // the magnitude of the remaining microseconds.
    int32_t seconds = 0, microseconds = 0;
    plist_get_date_val(node, &seconds, &microseconds);
    double fraction = microseconds / kMicrosecondsPerSecond;
    return Value(Date{seconds < 0 ? seconds - fraction : seconds + fraction});
  }

  std::optional<Value> array(plist_t node, int depth) {
    Array items;
    items.reserve(plist_array_get_size(node));
    plist_array_iter rawIter = nullptr;
    plist_array_new_iter(node, &rawIter);
    std::unique_ptr<void, MallocFree> iter(rawIter);
    for (;;) {
      plist_t item = nullptr;
      plist_array_next_item(node, iter.get(), &item);
      if (!item) break;
      std::optional<Value> value = read(item, depth + 1);
      if (!value) return std::nullopt;
      items.push_back(std::move(*value));
    }
    return Value(std::move(items));
  }

  std::optional<Value> dictionary(plist_t node, int depth) {
    Dictionary entries;
    plist_dict_iter rawIter = nullptr;
    plist_dict_new_iter(node, &rawIter);
    std::unique_ptr<void, MallocFree> iter(rawIter);
    for (;;) {
      char* rawKey = nullptr;
      plist_t item = nullptr;
      plist_dict_next_item(node, iter.get(), &rawKey, &item);
      MallocPtr key(rawKey);
      if (!item) break;
      std::optional<Value> value = read(item, depth + 1);
      if (!value) return std::nullopt;
      // A repeated key keeps its last value.
      entries.insert_or_assign(std::string(key ? key.get() : ""), std::move(*value));
    }
    return Value(std::move(entries));
  }

  std::string problem_;
};

// Runs one of libplist's readers on `text` (at most 4 GiB); null when it
// refuses the text.
PlistPtr libplistRead(std::string_view text, void (*reader)(const char*, uint32_t, plist_t*)) {
  plist_t raw = nullptr;  // libplist leaves a non-null output untouched
  reader(text.data(), static_cast<uint32_t>(text.size()), &raw);
  return PlistPtr(raw);
}

// Parses `bytes`; on failure returns none and says why in *problem.
std::optional<Value> parseBytes(std::string_view bytes, std::string* problem) {
  if (bytes.starts_with(kUTF8ByteOrderMark)) bytes.remove_prefix(kUTF8ByteOrderMark.size());
  if (bytes.empty()) {
    *problem = "the document is empty";
    return std::nullopt;
  }
  if (bytes.size() > UINT32_MAX) {
    *problem = "the document is larger than 4 GiB";
    return std::nullopt;
  }
  const bool binary = bytes.starts_with(kBinaryMagic);
  detail::XMLCheck check;
  if (binary) {
    check.problem = detail::checkBinaryPropertyList(bytes);
  } else {
    check = detail::checkXMLPropertyList(bytes);
  }
  if (check.problem) {
    *problem = std::move(*check.problem);
    return std::nullopt;
  }
  PlistPtr root = binary ? libplistRead(bytes, plist_from_bin)
                         : libplistRead(check.rewritten.empty() ? bytes : check.rewritten, plist_from_xml);
  if (!root) {
    *problem = binary ? "malformed binary property list" : "malformed XML property list";
    return std::nullopt;
  }
  NodeReader reader;
  std::optional<Value> value = reader.read(root.get(), 0);
  if (!value) *problem = reader.problem();
  return value;
}

// ---- Values to libplist nodes ----

class NodeWriter {
 public:
  explicit NodeWriter(Format format) : format_(format) {}

  PlistPtr write(const Value& value, int depth) {
    if (depth > kMaxNestingDepth) return fail("nesting deeper than " + std::to_string(kMaxNestingDepth) + " levels");
    switch (value.type()) {
      case Value::Type::Null: return fail("a null value cannot be written");
      case Value::Type::Boolean: return PlistPtr(plist_new_bool(value.boolValue() ? 1 : 0));
      case Value::Type::Integer: return PlistPtr(plist_new_uint(static_cast<uint64_t>(value.int64Value())));
      case Value::Type::Unsigned: return unsignedInteger(value.uint64Value());
      case Value::Type::Real: return PlistPtr(plist_new_real(value.doubleValue()));
      case Value::Type::String: return string(*value.asString());
      case Value::Type::Data: {
        const Data& data = *value.asData();
        return PlistPtr(plist_new_data(reinterpret_cast<const char*>(data.data()), data.size()));
      }
      case Value::Type::Date: return date(value.asDate()->secondsSinceReferenceDate);
      case Value::Type::Array: return array(*value.asArray(), depth);
      case Value::Type::Dictionary: return dictionary(*value.asDictionary(), depth);
      case Value::Type::URL:
        if (depth == 0) return fail("a URL is not a property-list value");
        return string(value.asURL()->path());
      case Value::Type::Error: return fail("an error record cannot be written");
    }
    return fail("a value of unknown type");
  }

  // A root dictionary whose entries keep the given order.
  PlistPtr orderedDictionary(const OrderedEntries& entries) { return dictionary(entries, 0); }

  const std::string& problem() const { return problem_; }

 private:
  PlistPtr fail(std::string problem) {
    if (problem_.empty()) problem_ = std::move(problem);
    return nullptr;
  }

  // Text libplist can store without loss: no NUL (it takes C strings) and,
  // for the binary form, well-formed UTF-8.
  bool checkText(std::string_view s, const char* what) {
    if (s.find('\0') != std::string_view::npos) {
      fail(std::string(what) + " \"" + std::string(s.substr(0, s.find('\0'))) + "\" contains a NUL character");
      return false;
    }
    if (format_ == Format::Binary && !isValidUTF8(s)) {
      fail(std::string(what) + " \"" + std::string(s) + "\" is not UTF-8, which a binary property list requires");
      return false;
    }
    return true;
  }

  PlistPtr string(const std::string& s) {
    if (!checkText(s, "string")) return nullptr;
    return PlistPtr(plist_new_string(s.c_str()));
  }

  PlistPtr unsignedInteger(uint64_t u) {
    if (u <= static_cast<uint64_t>(INT64_MAX)) return PlistPtr(plist_new_uint(u));
    // Only a node read from a document keeps the value unsigned.
    std::string document = "<plist><integer>" + std::to_string(u) + "</integer></plist>";
    plist_t raw = nullptr;
    plist_from_xml(document.data(), static_cast<uint32_t>(document.size()), &raw);
    PlistPtr node(raw);
    if (!node) return fail("libplist could not represent the integer " + std::to_string(u));
    return node;
  }

  PlistPtr date(double seconds) {
    double whole = std::floor(seconds);
    if (!std::isfinite(seconds) || whole < kEarliestDate || whole > kLatestDate) {
      return fail("the date " + std::to_string(seconds) + " is outside the range a property list can hold");
    }
    double microseconds = std::round((seconds - whole) * kMicrosecondsPerSecond);
    if (microseconds >= kMicrosecondsPerSecond) {  // rounded up to the next second
      microseconds = whole < kLatestDate ? 0 : kMicrosecondsPerSecond - 1;
      if (whole < kLatestDate) whole += 1;
    }
    return PlistPtr(plist_new_date(static_cast<int32_t>(whole), static_cast<int32_t>(microseconds)));
  }

  PlistPtr array(const Array& items, int depth) {
    PlistPtr node(plist_new_array());
    for (const Value& item : items) {
      PlistPtr child = write(item, depth + 1);
      if (!child) return nullptr;
      plist_array_append_item(node.get(), child.release());
    }
    return node;
  }

  template <class Entries>
  PlistPtr dictionary(const Entries& entries, int depth) {
    PlistPtr node(plist_new_dict());
    for (const auto& [key, item] : entries) {
      if (!checkText(key, "key")) return nullptr;
      PlistPtr child = write(item, depth + 1);
      if (!child) return nullptr;
      plist_dict_set_item(node.get(), key.c_str(), child.release());
    }
    return node;
  }

  Format format_;
  std::string problem_;
};

// Runs one of libplist's writers on `root`; none when it produces nothing.
template <class Free>
std::optional<Data> libplistWrite(plist_t root, void (*writer)(plist_t, char**, uint32_t*)) {
  char* raw = nullptr;  // libplist leaves a non-null output untouched
  uint32_t length = 0;
  writer(root, &raw, &length);
  std::unique_ptr<char, Free> buffer(raw);
  if (!buffer) return std::nullopt;
  return Data(buffer.get(), buffer.get() + length);
}

// Serialises the node `build` makes with a NodeWriter; on failure returns
// none and says why in *problem.
template <class Build>
std::optional<Data> serializeWith(Format format, std::string* problem, const Build& build) {
  NodeWriter writer(format);
  PlistPtr root = build(writer);
  if (!root) {
    *problem = writer.problem();
    return std::nullopt;
  }
  std::optional<Data> out = format == Format::XML ? libplistWrite<XMLFree>(root.get(), plist_to_xml)
                                                  : libplistWrite<BinaryFree>(root.get(), plist_to_bin);
  if (!out) *problem = "libplist could not produce the " + std::string(formatName(format)) + " form";
  return out;
}

std::optional<Data> serializeValue(const Value& value, Format format, std::string* problem) {
  return serializeWith(format, problem, [&](NodeWriter& writer) { return writer.write(value, 0); });
}

}  // namespace

std::optional<Value> parse(const void* bytes, size_t length, Error* error) {
  std::string problem;
  std::optional<Value> value =
      parseBytes(std::string_view(bytes ? static_cast<const char*>(bytes) : "", bytes ? length : 0), &problem);
  if (!value) {
    failWith(error, Error(kFileErrorDomain, kFileReadUnknownError,
                          Dictionary{{kLocalizedDescriptionKey, Value("Not a valid property list: " + problem)}}));
  }
  return value;
}

std::optional<Value> readFile(const URL& url, Error* error) {
  return readFile(url, ReadOptions{}, error);
}

std::optional<Value> readFile(const URL& url, const ReadOptions& options, Error* error) {
  std::optional<Data> bytes = readFileBytes(url, options, error);
  if (!bytes) return std::nullopt;
  std::string problem;
  std::optional<Value> value =
      parseBytes(std::string_view(reinterpret_cast<const char*>(bytes->data()), bytes->size()), &problem);
  if (!value) failWith(error, FileReadError(url, "not a valid property list: " + problem));
  return value;
}

std::optional<Dictionary> readDictionary(const URL& url, Error* error) {
  return readDictionary(url, ReadOptions{}, error);
}

std::optional<Dictionary> readDictionary(const URL& url, const ReadOptions& options, Error* error) {
  std::optional<Value> value = readFile(url, options, error);
  if (!value) return std::nullopt;
  if (Dictionary* dictionary = value->asDictionary()) return std::move(*dictionary);
  std::string_view type = value->typeName();
  const char* article = std::string_view("aeiouAEIOU").find(type.front()) == std::string_view::npos ? "a " : "an ";
  failWith(error, FileReadError(url, "the property list's root is " + std::string(article) + std::string(type) +
                                         ", not a dictionary"));
  return std::nullopt;
}

std::optional<Data> serialize(const Value& value, Format format, Error* error) {
  std::string problem;
  std::optional<Data> data = serializeValue(value, format, &problem);
  if (!data) {
    failWith(error, Error(kFileErrorDomain, kFileWriteUnknownError,
                          Dictionary{{kLocalizedDescriptionKey, Value("Cannot write a property list: " + problem)}}));
  }
  return data;
}

bool writeFile(const Value& value, const URL& url, Format format, bool atomically, Error* error,
               Durability durability) {
  std::string problem;
  std::optional<Data> data = serializeValue(value, format, &problem);
  if (!data) return failWith(error, FileWriteError(url, problem));
  return writeFileBytes(*data, url, atomically, error, durability);
}

bool writeOrderedDictionary(const OrderedEntries& entries, const URL& url, Format format, bool atomically,
                            Error* error, Durability durability) {
  std::string problem;
  std::optional<Data> data =
      serializeWith(format, &problem, [&](NodeWriter& writer) { return writer.orderedDictionary(entries); });
  if (!data) return failWith(error, FileWriteError(url, problem));
  return writeFileBytes(*data, url, atomically, error, durability);
}

}  // namespace platform::plist
