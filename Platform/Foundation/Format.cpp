#include "Platform/Foundation/Format.h"

#include <atomic>
#include <cstdio>
#include <cstring>

namespace platform {

namespace {

std::atomic<uint64_t> gMismatches{0};

void noteMismatch() { gMismatches.fetch_add(1, std::memory_order_relaxed); }

struct Directive {
  std::string flags;
  int width = -1;
  int precision = -1;
  std::string length;  // "", "hh", "h", "l", "ll", "z", "j", "t", "q"
  char conversion = 0;
};

// Pads `text` to the directive's width, honouring the "-" flag.
std::string pad(std::string text, const Directive& directive) {
  if (directive.width > 0 && static_cast<int>(text.size()) < directive.width) {
    std::string fill(directive.width - text.size(), ' ');
    bool left = directive.flags.find('-') != std::string::npos;
    text = left ? text + fill : fill + text;
  }
  return text;
}

std::string printfDirective(const Directive& directive, const char* length, char conversion) {
  std::string f = "%" + directive.flags;
  if (directive.width >= 0) f += std::to_string(directive.width);
  if (directive.precision >= 0) f += "." + std::to_string(directive.precision);
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

std::string formatSigned(const Directive& directive, const FormatArg& arg) {
  int64_t v = arg.signedValue();
  switch (lengthBits(directive.length)) {
    case 8: v = static_cast<int8_t>(v); break;
    case 16: v = static_cast<int16_t>(v); break;
    case 32: v = static_cast<int32_t>(v); break;
    default: break;
  }
  return snprintfOne(printfDirective(directive, "ll", 'd'), static_cast<long long>(v));
}

std::string formatUnsigned(const Directive& directive, const FormatArg& arg, char conversion) {
  uint64_t v = arg.unsignedValue();
  switch (lengthBits(directive.length)) {
    case 8: v = static_cast<uint8_t>(v); break;
    case 16: v = static_cast<uint16_t>(v); break;
    case 32: v = static_cast<uint32_t>(v); break;
    default: break;
  }
  return snprintfOne(printfDirective(directive, "ll", conversion), static_cast<unsigned long long>(v));
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

std::string render(const Directive& directive, const FormatArg* arg) {
  if (!arg) {
    noteMismatch();
    return "<missing>";
  }
  using K = FormatArg::Kind;
  const bool integer = arg->kind() == K::Signed || arg->kind() == K::Unsigned;
  switch (directive.conversion) {
    case '@':
      if (arg->kind() == K::Object || arg->kind() == K::CString) {
        return pad(arg->isNull() ? "(null)" : arg->text(), directive);
      }
      break;
    case 's':
      if (arg->kind() == K::CString || (arg->kind() == K::Object && arg->isNull())) {
        std::string text = arg->isNull() ? "(null)" : arg->text();
        if (directive.precision >= 0 && static_cast<size_t>(directive.precision) < text.size()) text.resize(directive.precision);
        return pad(text, directive);
      }
      break;
    case 'd':
    case 'i':
      if (integer) return formatSigned(directive, *arg);
      break;
    case 'u':
    case 'x':
    case 'X':
    case 'o':
      if (integer) return formatUnsigned(directive, *arg, directive.conversion);
      break;
    case 'c':
      if (integer) return pad(std::string(1, static_cast<char>(arg->signedValue())), directive);
      break;
    case 'f':
    case 'F':
    case 'g':
    case 'G':
    case 'e':
    case 'E':
      if (arg->kind() == K::Real) return snprintfOne(printfDirective(directive, "", directive.conversion), arg->realValue());
      if (integer) {
        noteMismatch();
        return snprintfOne(printfDirective(directive, "", directive.conversion), static_cast<double>(arg->signedValue()));
      }
      break;
    case 'p':
      if (arg->kind() == K::Pointer || integer) {
        return pad(snprintfOne(std::string("%#llx"), static_cast<unsigned long long>(arg->unsignedValue())), directive);
      }
      break;
    default: break;
  }
  noteMismatch();
  return pad(fallbackText(*arg), directive);
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
    Directive directive;
    while (*p && std::strchr("-+ #0'", *p)) directive.flags += *p++;
    if (*p == '*') {
      const FormatArg* w = take();
      directive.width = w ? static_cast<int>(w->signedValue()) : 0;
      ++p;
    } else {
      while (*p >= '0' && *p <= '9') directive.width = (directive.width < 0 ? 0 : directive.width * 10) + (*p++ - '0');
    }
    if (*p == '.') {
      ++p;
      directive.precision = 0;
      if (*p == '*') {
        const FormatArg* w = take();
        directive.precision = w ? static_cast<int>(w->signedValue()) : 0;
        ++p;
      } else {
        while (*p >= '0' && *p <= '9') directive.precision = directive.precision * 10 + (*p++ - '0');
      }
    }
    while (*p && std::strchr("hlzjtqL", *p)) directive.length += *p++;
    if (!*p) {
      // A lone "%" at the end: printed as written.
      noteMismatch();
      out.append(start);
      break;
    }
    directive.conversion = *p;
    if (!std::strchr("@sdiuxXocfFgGeEp", directive.conversion)) {
      noteMismatch();
      out.append(start, p + 1);
      continue;
    }
    out += render(directive, take());
  }
  if (next < args.size()) noteMismatch();
  return out;
}

uint64_t formatMismatchCount() { return gMismatches.load(std::memory_order_relaxed); }

}  // namespace platform
