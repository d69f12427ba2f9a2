#include "Platform/Foundation/URL.h"

namespace platform {

namespace {

// Collapses repeated separators and drops a trailing one ("/" stays "/").
std::string normalize(std::string_view path) {
  std::string out;
  out.reserve(path.size());
  for (char c : path) {
    if (c == '/' && !out.empty() && out.back() == '/') continue;
    out += c;
  }
  if (out.size() > 1 && out.back() == '/') out.pop_back();
  return out;
}

}  // namespace

URL URL::fileURL(std::string_view path, bool isDirectory) {
  URL url;
  url.path_ = normalize(path);
  url.isDirectory_ = isDirectory;
  return url;
}

URL URL::appending(std::string_view component, bool isDirectory) const {
  return fileURL(path::join(path_, component), isDirectory);
}

URL URL::appendingPathExtension(std::string_view extension) const {
  std::string p = path_;
  p += '.';
  p += extension;
  return fileURL(p, isDirectory_);
}

URL URL::deletingLastPathComponent() const {
  if (path_.empty()) return URL();
  size_t slash = path_.rfind('/');
  if (slash == std::string::npos) return fileURL(".", true);
  if (slash == 0) return fileURL("/", true);
  return fileURL(path_.substr(0, slash), true);
}

std::string URL::lastPathComponent() const {
  if (path_.empty()) return "";
  if (path_ == "/") return "/";
  size_t slash = path_.rfind('/');
  return slash == std::string::npos ? path_ : path_.substr(slash + 1);
}

std::string URL::pathExtension() const {
  std::string last = lastPathComponent();
  size_t dot = last.rfind('.');
  if (dot == std::string::npos || dot == 0 || dot + 1 == last.size()) return "";
  return last.substr(dot + 1);
}

std::string URL::description() const {
  std::string out = "file://" + path_;
  if (isDirectory_ && (path_.empty() || path_.back() != '/')) out += '/';
  return out;
}

namespace path {

std::vector<std::string> components(std::string_view p) {
  std::vector<std::string> out;
  if (p.empty()) return out;
  size_t i = 0;
  if (p[0] == '/') {
    out.emplace_back("/");
    while (i < p.size() && p[i] == '/') ++i;
  }
  while (i < p.size()) {
    size_t next = p.find('/', i);
    if (next == std::string_view::npos) {
      out.emplace_back(p.substr(i));
      break;
    }
    out.emplace_back(p.substr(i, next - i));
    i = next;
    while (i < p.size() && p[i] == '/') ++i;
    if (i == p.size()) out.emplace_back("/");
  }
  return out;
}

std::string join(std::string_view base, std::string_view rest) {
  std::string out(base);
  while (!rest.empty() && rest.front() == '/') rest.remove_prefix(1);
  if (rest.empty()) return out;
  if (out.empty() || out.back() != '/') out += '/';
  out += rest;
  return out;
}

}  // namespace path

}  // namespace platform
