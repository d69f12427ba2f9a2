// Value: the object model of property lists and of "%@" format arguments.
//
// A Value is one of: null, boolean, signed integer, unsigned integer, real,
// string, data, date, array, dictionary, URL or Error. Signed and unsigned
// integers are kept apart so that UINT64_MAX survives a round trip. Strings
// are UTF-8 bytes (file-system names are stored losslessly, whatever their
// bytes). Dictionaries are ordered by key so that iteration is deterministic.
//
// Values have value semantics: copying a Value copies its contents.
// Type tests and accessors never throw; an accessor of the wrong type returns
// null (pointer accessors) or the given fallback.
//
// Thread safety: a Value is a plain value; distinct Values may be used from
// distinct threads, one Value needs external synchronisation to be shared
// between a writer and readers.
#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "Platform/Foundation/URL.h"

namespace platform {

class Value;
class Error;

namespace detail {

// A heap-held object with value semantics: copying copies the object. It keeps
// a Value two words wide and lets alternatives that are not complete where
// Value is declared (arrays and dictionaries of Values, Error) sit in its
// variant. Only a Value's own moved-from storage ever holds an empty box.
template <class T>
class Boxed {
 public:
  explicit Boxed(T object) : object_(std::make_unique<T>(std::move(object))) {}
  Boxed(const Boxed& other) : object_(std::make_unique<T>(*other.object_)) {}
  Boxed(Boxed&&) noexcept = default;
  Boxed& operator=(const Boxed& other) { return *this = Boxed(other); }
  Boxed& operator=(Boxed&&) noexcept = default;
  ~Boxed() = default;

  T& operator*() const { return *object_; }

 private:
  std::unique_ptr<T> object_;
};

}  // namespace detail

using Array = std::vector<Value>;
using Dictionary = std::map<std::string, Value, std::less<>>;
using Data = std::vector<uint8_t>;

// A point in time: seconds since 2001-01-01 00:00:00 UTC, the property-list
// epoch.
struct Date {
  double secondsSinceReferenceDate = 0;
  bool operator==(const Date&) const = default;
};

class Value {
 public:
  enum class Type { Null, Boolean, Integer, Unsigned, Real, String, Data, Date, Array, Dictionary, URL, Error };

  Value();  // null
  Value(std::nullptr_t);
  Value(bool b);
  Value(int i);
  Value(long i);
  Value(long long i);
  Value(unsigned u);
  Value(unsigned long u);
  Value(unsigned long long u);
  Value(double d);
  Value(const char* s);  // null pointer gives a null Value
  Value(std::string s);
  Value(std::string_view s);
  Value(Data d);
  Value(Date d);
  Value(Array a);
  Value(Dictionary d);
  Value(URL u);
  Value(Error e);

  Value(const Value& other);
  Value(Value&& other) noexcept;
  Value& operator=(const Value& other);
  Value& operator=(Value&& other) noexcept;
  ~Value();

  Type type() const { return static_cast<Type>(storage_.index()); }
  bool isNull() const { return type() == Type::Null; }
  bool isBoolean() const { return type() == Type::Boolean; }
  // True for booleans, integers (either signedness) and reals: what the
  // system's documents call a number object.
  bool isNumber() const;
  bool isInteger() const { return type() == Type::Integer || type() == Type::Unsigned; }
  bool isString() const { return type() == Type::String; }
  bool isData() const { return type() == Type::Data; }
  bool isDate() const { return type() == Type::Date; }
  bool isArray() const { return type() == Type::Array; }
  bool isDictionary() const { return type() == Type::Dictionary; }
  bool isURL() const { return type() == Type::URL; }
  bool isError() const { return type() == Type::Error; }

  // Pointer accessors: null when the Value is of another type.
  const std::string* asString() const;
  const Data* asData() const;
  const Array* asArray() const;
  Array* asArray();
  const Dictionary* asDictionary() const;
  Dictionary* asDictionary();
  const URL* asURL() const;
  const Error* asError() const;
  const Date* asDate() const;

  // Numeric views. boolValue: non-zero numbers are true; anything that is not
  // a number gives `fallback`. The integer views convert reals by truncation
  // and booleans to 0/1.
  bool boolValue(bool fallback = false) const;
  int64_t int64Value(int64_t fallback = 0) const;
  uint64_t uint64Value(uint64_t fallback = 0) const;
  double doubleValue(double fallback = 0) const;

  // Dictionary lookup: null when this is not a dictionary or has no such key.
  const Value* get(std::string_view key) const;

  // The textual description that "%@" prints: a string prints as itself,
  // numbers in decimal, booleans as 1 or 0, null as "(null)", data as
  // "{length = N, bytes = 0x...}", arrays as "(a, b)", dictionaries as
  // "{k = v; k2 = v2; }", URLs and Errors as their own descriptions.
  std::string description() const;

  // Name of the type, for messages ("string", "dictionary", ...).
  std::string_view typeName() const;

  // Deep equality. Integers of either signedness compare by value; a real
  // never equals an integer.
  bool operator==(const Value& other) const;

 private:
  // The alternatives in the order of Type, so that the index is the type.
  using Storage =
      std::variant<std::monostate, bool, int64_t, uint64_t, double, detail::Boxed<std::string>, detail::Boxed<Data>,
                   Date, detail::Boxed<Array>, detail::Boxed<Dictionary>, detail::Boxed<URL>, detail::Boxed<Error>>;

  template <class T>
  T* boxed() const;

  Storage storage_;
};

// Convenience: an Array of strings.
Array makeStringArray(std::initializer_list<std::string_view> items);

}  // namespace platform
