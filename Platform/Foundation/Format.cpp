#include "Platform/Foundation/Format.h"

#include <atomic>
#include <cstdio>
#include <cstring>

namespace platform {

namespace {

std::atomic<uint64_t> gMismatches{0};

void noteMismatch() { gMismatches.fetch_add(1, std::memory_order_relaxed); }

struct Spec {
  std::string flags;
  int width = -1;
  int precision = -1;
  std::string length;  // "", "hh", "h", "l", "ll", "z", "j", "t", "q"
  char conversion = 0;
};

// Pads `text` to the spec's width, honouring the "-" flag.
std::string pad(std::string text, const Spec& spec) {
  if (spec.width > 0 && static_cast<int>(text.size()) < spec.width) {
    std::string fill(spec.width - text.size(), ' ');
    bool left = spec.flags.find('-') != std::string::npos;
    text = left ? text + fill : fill + text;
  }
  return text;
}

std::string printfSpec(const Spec& spec, const char* length, char conversion) {
  std::string f = "%" + spec.flags;
  if (spec.width >= 0) f += std::to_string(spec.width);
  if (spec.precision >= 0) f += "." + std::to_string(spec.precision);
  f += length;
  f += conversion;
  return f;
}

template <class T>
std::string snprintfOne(const std::string& f, T value) {
  char small[128];
  int n = std::snprintf(small, sizeof small, f.c_str(), value);
  if (n < 0) return "";
  if (static_cast<size_t>(n) < sizeof small) return std::string(small, n);
  std::string big(n + 1, '\0');
  std::snprintf(big.data(), big.size(), f.c_str(), value);
  big.resize(n);
  return big;
}

// Width in bits of an integer conversion's length modifier.
int lengthBits(const std::string& length) {
  if (length == "hh") return 8;
  if (length == "h") return 16;
  if (length.empty()) return 32;
  return 64;
}

std::string formatSigned(const Spec& spec, const FormatArg& arg) {
  int64_t v = arg.signedValue();
  switch (lengthBits(spec.length)) {
    case 8: v = static_cast<int8_t>(v); break;
    case 16: v = static_cast<int16_t>(v); break;
    case 32: v = static_cast<int32_t>(v); break;
    default: break;
  }
  return snprintfOne(printfSpec(spec, "ll", 'd'), static_cast<long long>(v));
}

std::string formatUnsigned(const Spec& spec, const FormatArg& arg, char conversion) {
  uint64_t v = arg.unsignedValue();
  switch (lengthBits(spec.length)) {
    case 8: v = static_cast<uint8_t>(v); break;
    case 16: v = static_cast<uint16_t>(v); break;
    case 32: v = static_cast<uint32_t>(v); break;
    default: break;
  }
  return snprintfOne(printfSpec(spec, "ll", conversion), static_cast<unsigned long long>(v));
}

// The text of an argument printed where it does not belong.
std::string fallbackText(const FormatArg& arg) {
  switch (arg.kind()) {
    case FormatArg::Kind::Signed: return std::to_string(arg.signedValue());
    case FormatArg::Kind::Unsigned: return std::to_string(arg.unsignedValue());
    case FormatArg::Kind::Real: return snprintfOne(std::string("%g"), arg.realValue());
    case FormatArg::Kind::Pointer: return snprintfOne(std::string("%#llx"), (unsigned long long)arg.unsignedValue());
    case FormatArg::Kind::CString:
    case FormatArg::Kind::Object: return arg.isNull() ? "(null)" : arg.text();
  }
  return "";
}

std::string render(const Spec& spec, const FormatArg* arg) {
  if (!arg) {
    noteMismatch();
    return "<missing>";
  }
  using K = FormatArg::Kind;
  const bool integer = arg->kind() == K::Signed || arg->kind() == K::Unsigned;
  switch (spec.conversion) {
    case '@':
      if (arg->kind() == K::Object || arg->kind() == K::CString) {
        return pad(arg->isNull() ? "(null)" : arg->text(), spec);
      }
      break;
    case 's':
      if (arg->kind() == K::CString || (arg->kind() == K::Object && arg->isNull())) {
        std::string text = arg->isNull() ? "(null)" : arg->text();
        if (spec.precision >= 0 && static_cast<size_t>(spec.precision) < text.size()) text.resize(spec.precision);
        return pad(text, spec);
      }
      break;
    case 'd':
    case 'i':
      if (integer) return formatSigned(spec, *arg);
      break;
    case 'u':
    case 'x':
    case 'X':
    case 'o':
      if (integer) return formatUnsigned(spec, *arg, spec.conversion);
      break;
    case 'c':
      if (integer) return pad(std::string(1, static_cast<char>(arg->signedValue())), spec);
      break;
    case 'f':
    case 'F':
    case 'g':
    case 'G':
    case 'e':
    case 'E':
      if (arg->kind() == K::Real) return snprintfOne(printfSpec(spec, "", spec.conversion), arg->realValue());
      if (integer) {
        noteMismatch();
        return snprintfOne(printfSpec(spec, "", spec.conversion), static_cast<double>(arg->signedValue()));
      }
      break;
    case 'p':
      if (arg->kind() == K::Pointer || integer) {
        return pad(snprintfOne(std::string("%#llx"), static_cast<unsigned long long>(arg->unsignedValue())), spec);
      }
      break;
    default: break;
  }
  noteMismatch();
  return pad(fallbackText(*arg), spec);
}

}  // namespace

std::string FormatV(const char* format, FormatArgs args) {
  std::string out;
  if (!format) return out;
  size_t next = 0;
  auto take = [&]() -> const FormatArg* { return next < args.size() ? &args[next++] : nullptr; };

  for (const char* p = format; *p; ++p) {
    if (*p != '%') {
      out += *p;
      continue;
    }
    const char* start = p++;
    if (*p == '%') {
      out += '%';
      continue;
    }
    Spec spec;
    while (*p && std::strchr("-+ #0'", *p)) spec.flags += *p++;
    if (*p == '*') {
      const FormatArg* w = take();
      spec.width = w ? static_cast<int>(w->signedValue()) : 0;
      ++p;
    } else {
      while (*p >= '0' && *p <= '9') spec.width = (spec.width < 0 ? 0 : spec.width * 10) + (*p++ - '0');
    }
    if (*p == '.') {
      ++p;
      spec.precision = 0;
      if (*p == '*') {
        const FormatArg* w = take();
        spec.precision = w ? static_cast<int>(w->signedValue()) : 0;
        ++p;
      } else {
        while (*p >= '0' && *p <= '9') spec.precision = spec.precision * 10 + (*p++ - '0');
      }
    }
    while (*p && std::strchr("hlzjtqL", *p)) spec.length += *p++;
    if (!*p) {
      // A lone "%" at the end: printed as written.
      noteMismatch();
      out.append(start);
      break;
    }
    spec.conversion = *p;
    if (!std::strchr("@sdiuxXocfFgGeEp", spec.conversion)) {
      noteMismatch();
      out.append(start, p + 1);
      continue;
    }
    out += render(spec, take());
  }
  if (next < args.size()) noteMismatch();
  return out;
}

uint64_t formatMismatchCount() { return gMismatches.load(std::memory_order_relaxed); }

}  // namespace platform
