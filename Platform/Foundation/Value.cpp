#include "Platform/Foundation/Value.h"

#include <cctype>
#include <cinttypes>
#include <cmath>
#include <cstdio>

#include "Platform/Foundation/Error.h"

namespace platform {

namespace {

// Heap payloads of the non-scalar types.
template <class T>
T* payload(void* p) {
  return static_cast<T*>(p);
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

Value::Value() : i_(0) {}
Value::Value(std::nullptr_t) : Value() {}
Value::Value(bool b) : type_(Type::Boolean), b_(b) {}
Value::Value(int i) : type_(Type::Integer), i_(i) {}
Value::Value(long i) : type_(Type::Integer), i_(i) {}
Value::Value(long long i) : type_(Type::Integer), i_(i) {}
Value::Value(unsigned u) : type_(Type::Unsigned), u_(u) {}
Value::Value(unsigned long u) : type_(Type::Unsigned), u_(u) {}
Value::Value(unsigned long long u) : type_(Type::Unsigned), u_(u) {}
Value::Value(double d) : type_(Type::Real), d_(d) {}
Value::Value(const char* s) : Value() {
  if (s) {
    type_ = Type::String;
    p_ = new std::string(s);
  }
}
Value::Value(std::string s) : type_(Type::String), p_(new std::string(std::move(s))) {}
Value::Value(std::string_view s) : type_(Type::String), p_(new std::string(s)) {}
Value::Value(Data d) : type_(Type::Data), p_(new Data(std::move(d))) {}
Value::Value(Date d) : type_(Type::Date), p_(new Date(d)) {}
Value::Value(Array a) : type_(Type::Array), p_(new Array(std::move(a))) {}
Value::Value(Dictionary d) : type_(Type::Dictionary), p_(new Dictionary(std::move(d))) {}
Value::Value(URL u) : type_(Type::URL), p_(new URL(std::move(u))) {}
Value::Value(Error e) : type_(Type::Error), p_(new Error(std::move(e))) {}

Value::Value(const Value& other) : i_(0) { copyFrom(other); }
Value::Value(Value&& other) noexcept : i_(0) { moveFrom(std::move(other)); }
Value& Value::operator=(const Value& other) {
  if (this != &other) {
    Value copy(other);
    destroy();
    moveFrom(std::move(copy));
  }
  return *this;
}
Value& Value::operator=(Value&& other) noexcept {
  if (this != &other) {
    // `other` may live inside this Value (v = std::move((*v.asArray())[0])):
    // take it out before destroying what holds it.
    Value taken(std::move(other));
    destroy();
    moveFrom(std::move(taken));
  }
  return *this;
}
Value::~Value() { destroy(); }

void Value::destroy() noexcept {
  switch (type_) {
    case Type::String: delete payload<std::string>(p_); break;
    case Type::Data: delete payload<Data>(p_); break;
    case Type::Date: delete payload<Date>(p_); break;
    case Type::Array: delete payload<Array>(p_); break;
    case Type::Dictionary: delete payload<Dictionary>(p_); break;
    case Type::URL: delete payload<URL>(p_); break;
    case Type::Error: delete payload<Error>(p_); break;
    default: break;
  }
  type_ = Type::Null;
  i_ = 0;
}

void Value::copyFrom(const Value& other) {
  switch (other.type_) {
    case Type::String: p_ = new std::string(*payload<std::string>(other.p_)); break;
    case Type::Data: p_ = new Data(*payload<Data>(other.p_)); break;
    case Type::Date: p_ = new Date(*payload<Date>(other.p_)); break;
    case Type::Array: p_ = new Array(*payload<Array>(other.p_)); break;
    case Type::Dictionary: p_ = new Dictionary(*payload<Dictionary>(other.p_)); break;
    case Type::URL: p_ = new URL(*payload<URL>(other.p_)); break;
    case Type::Error: p_ = new Error(*payload<Error>(other.p_)); break;
    default: u_ = other.u_; break;
  }
  type_ = other.type_;
}

void Value::moveFrom(Value&& other) noexcept {
  type_ = other.type_;
  u_ = other.u_;  // copies the scalar or steals the payload pointer
  other.type_ = Type::Null;
  other.i_ = 0;
}

bool Value::isNumber() const {
  return type_ == Type::Boolean || type_ == Type::Integer || type_ == Type::Unsigned || type_ == Type::Real;
}

const std::string* Value::asString() const { return type_ == Type::String ? payload<std::string>(p_) : nullptr; }
const Data* Value::asData() const { return type_ == Type::Data ? payload<Data>(p_) : nullptr; }
const Array* Value::asArray() const { return type_ == Type::Array ? payload<Array>(p_) : nullptr; }
Array* Value::asArray() { return type_ == Type::Array ? payload<Array>(p_) : nullptr; }
const Dictionary* Value::asDictionary() const {
  return type_ == Type::Dictionary ? payload<Dictionary>(p_) : nullptr;
}
Dictionary* Value::asDictionary() { return type_ == Type::Dictionary ? payload<Dictionary>(p_) : nullptr; }
const URL* Value::asURL() const { return type_ == Type::URL ? payload<URL>(p_) : nullptr; }
const Error* Value::asError() const { return type_ == Type::Error ? payload<Error>(p_) : nullptr; }
const Date* Value::asDate() const { return type_ == Type::Date ? payload<Date>(p_) : nullptr; }

bool Value::boolValue(bool fallback) const {
  switch (type_) {
    case Type::Boolean: return b_;
    case Type::Integer: return i_ != 0;
    case Type::Unsigned: return u_ != 0;
    case Type::Real: return d_ != 0;
    default: return fallback;
  }
}

int64_t Value::int64Value(int64_t fallback) const {
  switch (type_) {
    case Type::Boolean: return b_ ? 1 : 0;
    case Type::Integer: return i_;
    case Type::Unsigned: return static_cast<int64_t>(u_);
    case Type::Real:
      if (std::isnan(d_)) return 0;
      if (d_ >= 9.2233720368547758e18) return INT64_MAX;
      if (d_ <= -9.2233720368547758e18) return INT64_MIN;
      return static_cast<int64_t>(d_);
    default: return fallback;
  }
}

uint64_t Value::uint64Value(uint64_t fallback) const {
  switch (type_) {
    case Type::Boolean: return b_ ? 1 : 0;
    case Type::Integer: return static_cast<uint64_t>(i_);
    case Type::Unsigned: return u_;
    case Type::Real:
      if (std::isnan(d_) || d_ <= 0) return d_ <= -1 ? static_cast<uint64_t>(int64Value()) : 0;
      if (d_ >= 1.8446744073709552e19) return UINT64_MAX;
      return static_cast<uint64_t>(d_);
    default: return fallback;
  }
}

double Value::doubleValue(double fallback) const {
  switch (type_) {
    case Type::Boolean: return b_ ? 1 : 0;
    case Type::Integer: return static_cast<double>(i_);
    case Type::Unsigned: return static_cast<double>(u_);
    case Type::Real: return d_;
    default: return fallback;
  }
}

const Value* Value::get(std::string_view key) const {
  const Dictionary* d = asDictionary();
  if (!d) return nullptr;
  auto it = d->find(key);
  return it == d->end() ? nullptr : &it->second;
}

std::string Value::description() const {
  switch (type_) {
    case Type::Null: return "(null)";
    case Type::Boolean: return b_ ? "1" : "0";
    case Type::Integer: return std::to_string(i_);
    case Type::Unsigned: return std::to_string(u_);
    case Type::Real: return describeReal(d_);
    case Type::String: return *payload<std::string>(p_);
    case Type::Data: {
      const Data& data = *payload<Data>(p_);
      std::string out = "{length = " + std::to_string(data.size()) + ", bytes = 0x";
      static const char kHex[] = "0123456789abcdef";
      size_t shown = data.size() <= 24 ? data.size() : 8;
      for (size_t i = 0; i < shown; ++i) {
        out += kHex[data[i] >> 4];
        out += kHex[data[i] & 15];
      }
      if (shown < data.size()) out += "...";
      return out + "}";
    }
    case Type::Date: {
      char buf[48];
      std::snprintf(buf, sizeof buf, "%.3f seconds since 2001-01-01", payload<Date>(p_)->secondsSinceReferenceDate);
      return buf;
    }
    case Type::Array: {
      std::string out = "(";
      bool first = true;
      for (const Value& v : *payload<Array>(p_)) {
        if (!first) out += ", ";
        first = false;
        out += describeNested(v);
      }
      return out + ")";
    }
    case Type::Dictionary: {
      std::string out = "{";
      for (const auto& [k, v] : *payload<Dictionary>(p_)) {
        out += quoteIfNeeded(k) + " = " + describeNested(v) + "; ";
      }
      return out + "}";
    }
    case Type::URL: return payload<URL>(p_)->description();
    case Type::Error: return payload<Error>(p_)->description();
  }
  return "";
}

std::string_view Value::typeName() const {
  switch (type_) {
    case Type::Null: return "null";
    case Type::Boolean: return "boolean";
    case Type::Integer: return "integer";
    case Type::Unsigned: return "integer";
    case Type::Real: return "real";
    case Type::String: return "string";
    case Type::Data: return "data";
    case Type::Date: return "date";
    case Type::Array: return "array";
    case Type::Dictionary: return "dictionary";
    case Type::URL: return "URL";
    case Type::Error: return "error";
  }
  return "unknown";
}

bool Value::operator==(const Value& other) const {
  if (isInteger() && other.isInteger()) {
    if (type_ == other.type_) return u_ == other.u_;
    // Mixed signedness: equal only when both are the same non-negative number.
    int64_t s = type_ == Type::Integer ? i_ : other.i_;
    uint64_t u = type_ == Type::Unsigned ? u_ : other.u_;
    return s >= 0 && static_cast<uint64_t>(s) == u;
  }
  if (type_ != other.type_) return false;
  switch (type_) {
    case Type::Null: return true;
    case Type::Boolean: return b_ == other.b_;
    case Type::Real: return d_ == other.d_;
    case Type::String: return *payload<std::string>(p_) == *payload<std::string>(other.p_);
    case Type::Data: return *payload<Data>(p_) == *payload<Data>(other.p_);
    case Type::Date: return *payload<Date>(p_) == *payload<Date>(other.p_);
    case Type::Array: return *payload<Array>(p_) == *payload<Array>(other.p_);
    case Type::Dictionary: return *payload<Dictionary>(p_) == *payload<Dictionary>(other.p_);
    case Type::URL: return *payload<URL>(p_) == *payload<URL>(other.p_);
    case Type::Error: {
      const Error& a = *payload<Error>(p_);
      const Error& b = *payload<Error>(other.p_);
      return a.domain() == b.domain() && a.code() == b.code() && a.userInfo() == b.userInfo();
    }
    default: return false;
  }
}

Array makeStringArray(std::initializer_list<std::string_view> items) {
  Array out;
  out.reserve(items.size());
  for (std::string_view s : items) out.emplace_back(s);
  return out;
}

}  // namespace platform
