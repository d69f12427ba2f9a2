#include "Support/SupportFixtures.h"

#include <sys/xattr.h>

#include <cerrno>

#include "support/TestSupport.h"

namespace supporttest {

namespace {

constexpr char kPlistHeader[] =
    "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
    "<!DOCTYPE plist PUBLIC \"-//Apple//DTD PLIST 1.0//EN\" \"http://www.apple.com/DTDs/PropertyList-1.0.dtd\">\n"
    "<plist version=\"1.0\">\n";
constexpr char kPlistFooter[] = "</plist>\n";
constexpr char kProtectionClassAttribute[] = "user.com.vantrel.quilld.protection-class";

std::string escaped(const std::string& text) {
  std::string out;
  for (char c : text) {
    if (c == '&') out += "&amp;";
    else if (c == '<') out += "&lt;";
    else if (c == '>') out += "&gt;";
    else out += c;
  }
  return out;
}

}  // namespace

bool writeStringDictionaryPlist(const std::string& path, const std::map<std::string, std::string>& entries) {
  std::string xml = kPlistHeader;
  xml += "<dict>\n";
  for (const auto& [key, value] : entries) {
    xml += "\t<key>" + escaped(key) + "</key>\n\t<string>" + escaped(value) + "</string>\n";
  }
  xml += "</dict>\n";
  xml += kPlistFooter;
  return qstest::writeFile(path, xml);
}

bool writeStringArrayPlist(const std::string& path, const std::vector<std::string>& items) {
  std::string xml = kPlistHeader;
  xml += "<array>\n";
  for (const std::string& item : items) xml += "\t<string>" + escaped(item) + "</string>\n";
  xml += "</array>\n";
  xml += kPlistFooter;
  return qstest::writeFile(path, xml);
}

bool makeBundle(const std::string& directory, const std::map<std::string, std::string>& entries) {
  return qstest::makeDirs(directory) && writeStringDictionaryPlist(directory + "/Info.plist", entries);
}

std::optional<int32_t> protectionClassOf(const std::string& path) {
  int32_t value = 0;
  ssize_t n = getxattr(path.c_str(), kProtectionClassAttribute, &value, sizeof value);
  if (n < 0 && errno == ENODATA) return std::nullopt;
  if (n != static_cast<ssize_t>(sizeof value)) return -1;
  return value;
}

}  // namespace supporttest
