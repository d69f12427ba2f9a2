// Format: type-safe printf with "%@".
//
// Supported conversions: %@ %s %d %i %u %ld %lu %lld %llu %zd %zu %x %X %lx
// %llx %c %f %g %p and %%, with the flags "-+ #0", a field width and a
// precision. Each argument is captured as a FormatArg, which knows its kind;
// the conversion and the argument kind are checked against each other:
//   %@        any object (Value, URL, Error, string, anything with
//             description()), or a null object, which prints "(null)";
//   %s        a C string or std::string (a null C string prints "(null)");
//   %d %u %x  any integer (printed with the conversion's signedness and the
//             length modifier's width, as printf would);
//   %f %g     a real.
// A mismatch (or a missing argument) is a programming error: it never causes
// undefined behaviour; the argument is printed as best it can be, or
// "<missing>", and formatMismatchCount() grows so that tests can catch it.
//
// Thread safety: all functions may be called from any thread.
#pragma once

#include <concepts>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <type_traits>
#include <vector>

#include "Platform/Foundation/Error.h"
#include "Platform/Foundation/URL.h"
#include "Platform/Foundation/Value.h"

namespace platform {

template <class T>
concept Describable = requires(const T& t) {
  { t.description() } -> std::convertible_to<std::string>;
};

class FormatArg {
 public:
  enum class Kind { Signed, Unsigned, Real, CString, Object, Pointer };

  FormatArg(int v) : kind_(Kind::Signed), i_(v) {}
  FormatArg(long v) : kind_(Kind::Signed), i_(v) {}
  FormatArg(long long v) : kind_(Kind::Signed), i_(v) {}
  FormatArg(short v) : kind_(Kind::Signed), i_(v) {}
  FormatArg(signed char v) : kind_(Kind::Signed), i_(v) {}
  FormatArg(char v) : kind_(Kind::Signed), i_(v) {}
  FormatArg(unsigned v) : kind_(Kind::Unsigned), u_(v) {}
  FormatArg(unsigned long v) : kind_(Kind::Unsigned), u_(v) {}
  FormatArg(unsigned long long v) : kind_(Kind::Unsigned), u_(v) {}
  FormatArg(unsigned short v) : kind_(Kind::Unsigned), u_(v) {}
  FormatArg(unsigned char v) : kind_(Kind::Unsigned), u_(v) {}
  FormatArg(bool v) : kind_(Kind::Signed), i_(v ? 1 : 0) {}
  FormatArg(double v) : kind_(Kind::Real), d_(v) {}
  FormatArg(float v) : kind_(Kind::Real), d_(v) {}
  // C strings: usable with %s; with %@ they print as a string object.
  FormatArg(const char* s) : kind_(Kind::CString), isNull_(s == nullptr), text_(s ? s : "") {}
  FormatArg(char* s) : FormatArg(static_cast<const char*>(s)) {}
  FormatArg(const std::string& s) : kind_(Kind::CString), text_(s) {}
  FormatArg(std::string_view s) : kind_(Kind::CString), text_(s) {}
  // The null object: "%@" prints "(null)".
  FormatArg(std::nullptr_t) : kind_(Kind::Object), isNull_(true) {}
  FormatArg(const Value& v) : kind_(Kind::Object), isNull_(v.isNull()), text_(v.isNull() ? "" : v.description()) {}
  FormatArg(const Error& e) : kind_(Kind::Object), text_(e.description()) {}
  FormatArg(const URL& u) : kind_(Kind::Object), isNull_(u.empty()), text_(u.empty() ? "" : u.description()) {}
  FormatArg(const Array& a) : FormatArg(Value(a)) {}
  FormatArg(const Dictionary& d) : FormatArg(Value(d)) {}
  template <Describable T>
    requires(!std::same_as<T, Value> && !std::same_as<T, Error> && !std::same_as<T, URL>)
  FormatArg(const T& t) : kind_(Kind::Object), text_(t.description()) {}
  // Pointers to objects: null prints "(null)".
  template <class T>
    requires(Describable<T> || std::same_as<T, Value>)
  FormatArg(const T* t) : FormatArg(nullptr) {
    if (t) *this = FormatArg(*t);
  }
  template <class T>
  FormatArg(const std::optional<T>& o) : FormatArg(nullptr) {
    if (o) *this = FormatArg(*o);
  }
  FormatArg(const void* p) : kind_(Kind::Pointer), u_(reinterpret_cast<uintptr_t>(p)) {}

  Kind kind() const { return kind_; }
  bool isNull() const { return isNull_; }
  int64_t signedValue() const { return kind_ == Kind::Unsigned ? static_cast<int64_t>(u_) : i_; }
  uint64_t unsignedValue() const { return kind_ == Kind::Signed ? static_cast<uint64_t>(i_) : u_; }
  double realValue() const { return d_; }
  const std::string& text() const { return text_; }

 private:
  Kind kind_;
  bool isNull_ = false;
  union {
    int64_t i_;
    uint64_t u_;
    double d_ = 0;
  };
  std::string text_;
};

using FormatArgs = std::span<const FormatArg>;

// Formats `format` with `args`. A null format gives "".
std::string FormatV(const char* format, FormatArgs args);

template <class... Args>
std::string Format(const char* format, const Args&... args) {
  if constexpr (sizeof...(Args) == 0) {
    return FormatV(format, {});
  } else {
    const FormatArg captured[] = {FormatArg(args)...};
    return FormatV(format, captured);
  }
}

// Number of conversion/argument mismatches seen by this process so far.
uint64_t formatMismatchCount();

}  // namespace platform
