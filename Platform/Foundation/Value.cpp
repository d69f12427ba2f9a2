#include "Platform/Foundation/Value.h"

#include <cctype>
#include <cinttypes>
#include <cmath>
#include <cstdio>
#include <iterator>
#include <type_traits>
#include <utility>

#include "Platform/Foundation/Error.h"
#include "Platform/Foundation/Text.h"

namespace platform {

namespace {

using detail::Boxed;

// The visitor of several lambdas.
template <class... F>
struct Overloaded : F... {
  using F::operator()...;
};
template <class... F>
Overloaded(F...) -> Overloaded<F...>;

// The numeric views: booleans and integers convert as C++ converts them, reals
// through `fromReal`, anything that is not a number gives `fallback`.
template <class R, class Storage, class FromReal>
R numericView(const Storage& storage, R fallback, FromReal fromReal) {
  return std::visit(Overloaded{[&](double d) -> R { return fromReal(d); },
                               [&](const auto& x) -> R {
                                 if constexpr (std::is_integral_v<std::decay_t<decltype(x)>>) {
                                   return static_cast<R>(x);
                                 } else {
                                   return fallback;
                                 }
                               }},
                    storage);
}

std::string describeReal(double d) {
  if (std::isfinite(d) && d == std::floor(d) && std::fabs(d) < 1e15) {
    char buf[32];
    std::snprintf(buf, sizeof buf, "%.0f", d);
    return buf;
  }
  char buf[40];
  std::snprintf(buf, sizeof buf, "%.17g", d);
  return buf;
}

// Strings inside collections are quoted when they hold anything but plain
// characters, so that a description stays readable and unambiguous.
std::string quoteIfNeeded(const std::string& s) {
  bool plain = !s.empty();
  for (unsigned char c : s) {
    if (!(std::isalnum(c) || c == '.' || c == '_' || c == '-' || c == '/' || c == ':' || c >= 0x80)) {
      plain = false;
      break;
    }
  }
  if (plain) return s;
  std::string out = "\"";
  for (char c : s) {
    if (c == '"' || c == '\\') out += '\\';
    if (c == '\n') {
      out += "\\n";
      continue;
    }
    out += c;
  }
  out += '"';
  return out;
}

std::string describeNested(const Value& v) {
  if (const std::string* s = v.asString()) return quoteIfNeeded(*s);
  return v.description();
}

}  // namespace

Value::Value() = default;
Value::Value(std::nullptr_t) {}
Value::Value(bool b) : storage_(b) {}
Value::Value(int i) : storage_(int64_t{i}) {}
Value::Value(long i) : storage_(int64_t{i}) {}
Value::Value(long long i) : storage_(int64_t{i}) {}
Value::Value(unsigned u) : storage_(uint64_t{u}) {}
Value::Value(unsigned long u) : storage_(uint64_t{u}) {}
Value::Value(unsigned long long u) : storage_(uint64_t{u}) {}
Value::Value(double d) : storage_(d) {}
Value::Value(const char* s) {
  if (s) storage_.emplace<Boxed<std::string>>(std::string(s));
}
Value::Value(std::string s) : storage_(Boxed<std::string>(std::move(s))) {}
Value::Value(std::string_view s) : storage_(Boxed<std::string>(std::string(s))) {}
Value::Value(Data d) : storage_(Boxed<Data>(std::move(d))) {}
Value::Value(Date d) : storage_(d) {}
Value::Value(Array a) : storage_(Boxed<Array>(std::move(a))) {}
Value::Value(Dictionary d) : storage_(Boxed<Dictionary>(std::move(d))) {}
Value::Value(URL u) : storage_(Boxed<URL>(std::move(u))) {}
Value::Value(Error e) : storage_(Boxed<Error>(std::move(e))) {}

Value::Value(const Value& other) = default;
// A moved-from Value is null, never an empty box.
Value::Value(Value&& other) noexcept : storage_(std::exchange(other.storage_, std::monostate{})) {}
Value& Value::operator=(const Value& other) {
  // `other` may live inside this Value (v = (*v.asArray())[0]): copy it out
  // before replacing what holds it.
  if (this != &other) *this = Value(other);
  return *this;
}
Value& Value::operator=(Value&& other) noexcept {
  if (this != &other) {
    Value taken(std::move(other));
    storage_ = std::exchange(taken.storage_, std::monostate{});
  }
  return *this;
}
Value::~Value() = default;

template <class T>
T* Value::boxed() const {
  const Boxed<T>* box = std::get_if<Boxed<T>>(&storage_);
  return box ? &**box : nullptr;
}

bool Value::isNumber() const {
  return isBoolean() || isInteger() || type() == Type::Real;
}

const std::string* Value::asString() const {
  return boxed<std::string>();
}
const Data* Value::asData() const {
  return boxed<Data>();
}
const Array* Value::asArray() const {
  return boxed<Array>();
}
Array* Value::asArray() {
  return boxed<Array>();
}
const Dictionary* Value::asDictionary() const {
  return boxed<Dictionary>();
}
Dictionary* Value::asDictionary() {
  return boxed<Dictionary>();
}
const URL* Value::asURL() const {
  return boxed<URL>();
}
const Error* Value::asError() const {
  return boxed<Error>();
}
const Date* Value::asDate() const {
  return std::get_if<Date>(&storage_);
}

bool Value::boolValue(bool fallback) const {
  return numericView(storage_, fallback, [](double d) { return d != 0; });
}

int64_t Value::int64Value(int64_t fallback) const {
  return numericView(storage_, fallback, [](double d) -> int64_t {
    if (std::isnan(d)) return 0;
    if (d >= 9.2233720368547758e18) return INT64_MAX;
    if (d <= -9.2233720368547758e18) return INT64_MIN;
    return static_cast<int64_t>(d);
  });
}

uint64_t Value::uint64Value(uint64_t fallback) const {
  return numericView(storage_, fallback, [](double d) -> uint64_t {
    if (std::isnan(d) || d <= 0) return d <= -1 ? static_cast<uint64_t>(Value(d).int64Value()) : 0;
    if (d >= 1.8446744073709552e19) return UINT64_MAX;
    return static_cast<uint64_t>(d);
  });
}

double Value::doubleValue(double fallback) const {
  return numericView(storage_, fallback, [](double d) { return d; });
}

const Value* Value::get(std::string_view key) const {
  const Dictionary* d = asDictionary();
  if (!d) return nullptr;
  auto it = d->find(key);
  return it == d->end() ? nullptr : &it->second;
}

std::string Value::description() const {
  return std::visit(Overloaded{
                        [](std::monostate) -> std::string { return "(null)"; },
                        [](bool b) -> std::string { return b ? "1" : "0"; },
                        [](int64_t i) { return std::to_string(i); },
                        [](uint64_t u) { return std::to_string(u); },
                        [](double d) { return describeReal(d); },
                        [](const Boxed<std::string>& s) { return *s; },
                        [](const Boxed<Data>& boxedData) {
                          const Data& data = *boxedData;
                          std::string out = "{length = " + std::to_string(data.size()) + ", bytes = 0x";
                          size_t shown = data.size() <= 24 ? data.size() : 8;
                          out += hexString(data.data(), shown);
                          if (shown < data.size()) out += "...";
                          return out + "}";
                        },
                        [](const Date& date) -> std::string {
                          char buf[48];
                          std::snprintf(buf, sizeof buf, "%.3f seconds since 2001-01-01",
                                        date.secondsSinceReferenceDate);
                          return buf;
                        },
                        [](const Boxed<Array>& array) {
                          std::string out = "(";
                          bool first = true;
                          for (const Value& v : *array) {
                            if (!first) out += ", ";
                            first = false;
                            out += describeNested(v);
                          }
                          return out + ")";
                        },
                        [](const Boxed<Dictionary>& dictionary) {
                          std::string out = "{";
                          for (const auto& [k, v] : *dictionary)
                            out += quoteIfNeeded(k) + " = " + describeNested(v) + "; ";
                          return out + "}";
                        },
                        [](const Boxed<URL>& url) { return (*url).description(); },
                        [](const Boxed<Error>& error) { return (*error).description(); },
                    },
                    storage_);
}

std::string_view Value::typeName() const {
  static constexpr std::string_view kNames[] = {"null", "boolean", "integer", "integer",    "real", "string",
                                                "data", "date",    "array",   "dictionary", "URL",  "error"};
  static_assert(std::size(kNames) == std::variant_size_v<Storage>);
  static_assert(
      std::is_same_v<std::variant_alternative_t<static_cast<size_t>(Type::Unsigned), Storage>, uint64_t> &&
          std::is_same_v<std::variant_alternative_t<static_cast<size_t>(Type::Date), Storage>, Date> &&
          std::is_same_v<std::variant_alternative_t<static_cast<size_t>(Type::Error), Storage>, Boxed<Error>> &&
          std::variant_size_v<Storage> == static_cast<size_t>(Type::Error) + 1,
      "the variant's alternatives follow the order of Type");
  return kNames[storage_.index()];
}

bool Value::operator==(const Value& other) const {
  if (isInteger() && other.isInteger()) {
    if (type() == other.type()) return uint64Value() == other.uint64Value();
    // Mixed signedness: equal only when both are the same non-negative number.
    int64_t s = type() == Type::Integer ? int64Value() : other.int64Value();
    uint64_t u = type() == Type::Unsigned ? uint64Value() : other.uint64Value();
    return s >= 0 && static_cast<uint64_t>(s) == u;
  }
  if (type() != other.type()) return false;
  return std::visit(
      [&](const auto& mine) {
        using T = std::decay_t<decltype(mine)>;
        const T& theirs = *std::get_if<T>(&other.storage_);
        if constexpr (std::is_same_v<T, Boxed<Error>>) {
          const Error& a = *mine;
          const Error& b = *theirs;
          return a.domain() == b.domain() && a.code() == b.code() && a.userInfo() == b.userInfo();
        } else if constexpr (std::is_same_v<T, std::monostate> || std::is_arithmetic_v<T> || std::is_same_v<T, Date>) {
          return mine == theirs;
        } else {
          return *mine == *theirs;
        }
      },
      storage_);
}

Array makeStringArray(std::initializer_list<std::string_view> items) {
  Array out;
  out.reserve(items.size());
  for (std::string_view s : items) out.emplace_back(s);
  return out;
}

}  // namespace platform
