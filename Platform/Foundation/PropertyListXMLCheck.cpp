// The XML half of PropertyListCheck.h: a recursive-descent reader of the
// property-list subset of XML.
#include "Platform/Foundation/PropertyListCheck.h"

#include <charconv>
#include <cstdint>
#include <system_error>
#include <vector>

namespace platform::plist::detail {

namespace {

constexpr std::string_view kCommentOpen = "<!--";
constexpr std::string_view kCommentClose = "-->";
constexpr std::string_view kInstructionOpen = "<?";
constexpr std::string_view kInstructionClose = "?>";
constexpr std::string_view kCDATAOpen = "<![CDATA[";
constexpr std::string_view kCDATAClose = "]]>";
constexpr std::string_view kDoctypeOpen = "<!DOCTYPE";
constexpr std::string_view kWhitespace = " \t\r\n";
constexpr std::string_view kBase64Characters =
    "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/= \t\r\n";

bool isSpace(char c) { return kWhitespace.find(c) != std::string_view::npos; }
bool isDigit(char c) { return c >= '0' && c <= '9'; }
bool isHexDigit(char c) { return isDigit(c) || (c >= 'a' && c <= 'f') || (c >= 'A' && c <= 'F'); }
bool isNameChar(char c) {
  return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || isDigit(c) || c == '_' || c == ':' || c == '.' ||
         c == '-' || static_cast<unsigned char>(c) >= 0x80;
}

std::string_view trim(std::string_view s) {
  while (!s.empty() && isSpace(s.front())) s.remove_prefix(1);
  while (!s.empty() && isSpace(s.back())) s.remove_suffix(1);
  return s;
}

int digitValue(char c) {
  if (isDigit(c)) return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  return c - 'A' + 10;
}

// Decimal or "0x" hexadecimal, optionally signed, within the 64-bit range of
// its sign (negative down to INT64_MIN, positive up to UINT64_MAX).
bool isIntegerText(std::string_view t) {
  bool negative = false;
  if (!t.empty() && (t.front() == '-' || t.front() == '+')) {
    negative = t.front() == '-';
    t.remove_prefix(1);
  }
  int base = 10;
  if (t.size() > 2 && t[0] == '0' && (t[1] == 'x' || t[1] == 'X')) {
    base = 16;
    t.remove_prefix(2);
  }
  if (t.empty()) return false;
  uint64_t magnitude = 0;
  for (char c : t) {
    if (base == 10 ? !isDigit(c) : !isHexDigit(c)) return false;
    uint64_t digit = static_cast<uint64_t>(digitValue(c));
    if (magnitude > (UINT64_MAX - digit) / static_cast<uint64_t>(base)) return false;
    magnitude = magnitude * static_cast<uint64_t>(base) + digit;
  }
  return !negative || magnitude <= static_cast<uint64_t>(INT64_MAX) + 1;
}

// A decimal or "0x" hexadecimal floating-point number, or nan/inf/infinity,
// optionally signed; the whole text must be consumed. Read without regard to
// the process's locale.
bool isRealText(std::string_view t) {
  auto isSign = [](char c) { return c == '+' || c == '-'; };
  if (!t.empty() && isSign(t.front())) t.remove_prefix(1);  // only the form matters here
  if (t.empty() || isSign(t.front())) return false;
  auto format = std::chars_format::general;
  if (t.size() > 2 && t[0] == '0' && (t[1] == 'x' || t[1] == 'X')) {
    format = std::chars_format::hex;
    t.remove_prefix(2);
  }
  if (t.empty()) return false;
  double value = 0;
  auto [end, ec] = std::from_chars(t.data(), t.data() + t.size(), value, format);
  return end == t.data() + t.size() && (ec == std::errc() || ec == std::errc::result_out_of_range);
}

// Reads exactly `count` digits at `pos` into *value.
bool readDigits(std::string_view t, size_t& pos, size_t count, int* value) {
  if (pos + count > t.size()) return false;
  int v = 0;
  for (size_t i = 0; i < count; ++i) {
    if (!isDigit(t[pos + i])) return false;
    v = v * 10 + (t[pos + i] - '0');
  }
  pos += count;
  *value = v;
  return true;
}

bool expectChar(std::string_view t, size_t& pos, char c) {
  if (pos >= t.size() || t[pos] != c) return false;
  ++pos;
  return true;
}

// YYYY-MM-DDTHH:MM:SS, optionally with a fraction of a second, optionally
// followed by "Z": the form every property-list writer produces.
bool isDateText(std::string_view t) {
  size_t pos = 0;
  int year, month, day, hour, minute, second;
  if (!readDigits(t, pos, 4, &year) || !expectChar(t, pos, '-') || !readDigits(t, pos, 2, &month) ||
      !expectChar(t, pos, '-') || !readDigits(t, pos, 2, &day) || !expectChar(t, pos, 'T') ||
      !readDigits(t, pos, 2, &hour) || !expectChar(t, pos, ':') || !readDigits(t, pos, 2, &minute) ||
      !expectChar(t, pos, ':') || !readDigits(t, pos, 2, &second)) {
    return false;
  }
  if (month < 1 || month > 12 || day < 1 || day > 31 || hour > 23 || minute > 59 || second > 60) return false;
  if (pos < t.size() && t[pos] == '.') {
    ++pos;
    size_t digits = 0;
    while (pos < t.size() && isDigit(t[pos])) ++pos, ++digits;
    if (digits == 0) return false;
  }
  if (pos < t.size() && t[pos] == 'Z') ++pos;
  return pos == t.size();
}

bool isBase64Text(std::string_view t) { return t.find_first_not_of(kBase64Characters) == std::string_view::npos; }

struct Tag {
  std::string_view name;
  bool closing = false;
  bool empty = false;  // <name/>
};

// A recursive-descent reader of the property-list subset of XML that records
// the first problem it meets.
class Checker {
 public:
  explicit Checker(std::string_view text) : s_(text) {}

  XMLCheck run() {
    if (trim(s_).empty()) return {std::string("the document is empty"), {}};
    if (size_t nul = s_.find('\0'); nul != std::string_view::npos) {
      return {"a NUL character (byte " + std::to_string(nul) + ")", {}};
    }
    if (skipMisc() && skipDoctype() && skipMisc() && document() && skipMisc()) {
      if (pos_ == s_.size()) return {std::nullopt, rewritten()};
      fail("content after the end of the property list");
    }
    return {problem_ + " (byte " + std::to_string(problemOffset_) + ")", {}};
  }

 private:
  bool fail(std::string message) {
    if (problem_.empty()) {
      problem_ = std::move(message);
      problemOffset_ = pos_;
    }
    return false;
  }

  bool atEnd() const { return pos_ >= s_.size(); }
  bool startsWith(std::string_view prefix) const { return s_.substr(pos_).starts_with(prefix); }
  void skipSpace() {
    while (!atEnd() && isSpace(s_[pos_])) ++pos_;
  }

  // Moves past `terminator`, which must follow.
  bool skipPast(std::string_view terminator, const char* what) {
    size_t end = s_.find(terminator, pos_);
    if (end == std::string_view::npos) {
      pos_ = s_.size();
      return fail(std::string("unterminated ") + what);
    }
    pos_ = end + terminator.size();
    return true;
  }

  // Whitespace, comments and processing instructions (the XML declaration is
  // one of them).
  bool skipMisc() {
    for (;;) {
      skipSpace();
      if (startsWith(kCommentOpen)) {
        pos_ += kCommentOpen.size();
        if (!skipPast(kCommentClose, "comment")) return false;
      } else if (startsWith(kInstructionOpen)) {
        pos_ += kInstructionOpen.size();
        if (!skipPast(kInstructionClose, "processing instruction")) return false;
      } else {
        return true;
      }
    }
  }

  // <!DOCTYPE ...>, with quoted literals and an internal subset in brackets.
  bool skipDoctype() {
    if (!startsWith(kDoctypeOpen)) return true;
    pos_ += kDoctypeOpen.size();
    int brackets = 0;
    while (!atEnd()) {
      char c = s_[pos_++];
      if (c == '"' || c == '\'') {
        size_t end = s_.find(c, pos_);
        if (end == std::string_view::npos) break;
        pos_ = end + 1;
      } else if (c == '[') {
        ++brackets;
      } else if (c == ']') {
        --brackets;
      } else if (c == '>' && brackets <= 0) {
        return true;
      }
    }
    return fail("unterminated document type declaration");
  }

  bool readName(std::string_view* name) {
    size_t start = pos_;
    while (!atEnd() && isNameChar(s_[pos_])) ++pos_;
    if (pos_ == start) return fail("malformed tag");
    *name = s_.substr(start, pos_ - start);
    return true;
  }

  bool readAttributes() {
    for (;;) {
      skipSpace();
      if (atEnd()) return fail("unterminated tag");
      if (s_[pos_] == '>' || s_[pos_] == '/') return true;
      std::string_view attribute;
      if (!readName(&attribute)) return false;
      skipSpace();
      if (!expectChar(s_, pos_, '=')) return fail("attribute without a value");
      skipSpace();
      if (atEnd() || (s_[pos_] != '"' && s_[pos_] != '\'')) return fail("unquoted attribute value");
      char quote = s_[pos_++];
      size_t end = s_.find(quote, pos_);
      if (end == std::string_view::npos) return fail("unterminated attribute value");
      pos_ = end + 1;
    }
  }

  bool readTag(Tag* tag) {
    if (atEnd()) return fail("unexpected end of the document");
    if (s_[pos_] != '<') return fail("text where an element was expected");
    ++pos_;
    *tag = Tag{};
    if (!atEnd() && s_[pos_] == '/') {
      tag->closing = true;
      ++pos_;
    }
    if (!readName(&tag->name)) return false;
    if (tag->closing) {
      skipSpace();
    } else if (!readAttributes()) {
      return false;
    }
    if (!tag->closing && startsWith("/>")) {
      tag->empty = true;
      pos_ += 2;
      return true;
    }
    if (!expectChar(s_, pos_, '>')) return fail("malformed tag <" + std::string(tag->name) + ">");
    return true;
  }

  bool expectClosing(std::string_view name) {
    Tag tag;
    if (!readTag(&tag)) return false;
    if (!tag.closing || tag.name != name) {
      return fail(std::string(tag.closing ? "</" : "<") + std::string(tag.name) + "> where </" + std::string(name) +
                  "> was expected");
    }
    return true;
  }

  // An entity or character reference after '&'; appends what it stands for
  // (characters beyond ASCII as '?': only numbers and dates are inspected).
  bool readReference(std::string* out) {
    size_t end = s_.find(';', pos_);
    if (end == std::string_view::npos || end - pos_ > 10) return fail("'&' that starts no entity reference");
    std::string_view ref = s_.substr(pos_, end - pos_);
    static constexpr std::pair<std::string_view, char> kEntities[] = {
        {"amp", '&'}, {"lt", '<'}, {"gt", '>'}, {"quot", '"'}, {"apos", '\''}};
    for (const auto& [name, c] : kEntities) {
      if (ref == name) {
        *out += c;
        pos_ = end + 1;
        return true;
      }
    }
    bool hex = ref.starts_with("#x");
    std::string_view digits = ref.substr(hex ? 2 : 1);
    bool numeric = ref.starts_with("#") && !digits.empty();
    uint32_t code = 0;
    for (char c : digits) {
      if (!numeric || (hex ? !isHexDigit(c) : !isDigit(c))) {
        numeric = false;
        break;
      }
      code = code * (hex ? 16 : 10) + static_cast<uint32_t>(digitValue(c));
    }
    if (!numeric || code == 0 || code > 0x10FFFF) return fail("unknown entity reference &" + std::string(ref) + ";");
    *out += code < 0x80 ? static_cast<char>(code) : '?';
    pos_ = end + 1;
    return true;
  }

  // Character data up to the next tag, with comments, CDATA sections and
  // references resolved.
  bool readText(std::string* out) {
    while (!atEnd()) {
      char c = s_[pos_];
      if (c == '<') {
        if (startsWith(kCommentOpen)) {
          pos_ += kCommentOpen.size();
          if (!skipPast(kCommentClose, "comment")) return false;
          continue;
        }
        if (startsWith(kCDATAOpen)) {
          pos_ += kCDATAOpen.size();
          size_t end = s_.find(kCDATAClose, pos_);
          if (end == std::string_view::npos) return fail("unterminated CDATA section");
          *out += s_.substr(pos_, end - pos_);
          pos_ = end + kCDATAClose.size();
          continue;
        }
        return true;
      }
      ++pos_;
      if (c == '&') {
        if (!readReference(out)) return false;
      } else {
        *out += c;
      }
    }
    return fail("unexpected end of the document");
  }

  // The text of a leaf element whose start tag has been read, and the raw
  // bytes it came from.
  bool leafText(const Tag& tag, std::string* text, std::string_view* raw = nullptr) {
    if (tag.empty) return true;
    size_t start = pos_;
    if (!readText(text)) return false;
    if (raw) *raw = s_.substr(start, pos_ - start);
    return expectClosing(tag.name);
  }

  // libplist reads integers with strtoull's automatic base, so "010" would
  // be octal 8 and "08" would be 0. A plain decimal with leading zeros is
  // noted for rewriting without them.
  void noteLeadingZeros(std::string_view raw) {
    if (raw.find_first_of("&<") != std::string_view::npos) return;
    std::string_view content = trim(raw);
    size_t digits = !content.empty() && (content.front() == '-' || content.front() == '+') ? 1 : 0;
    size_t first = digits;
    while (first + 1 < content.size() && content[first] == '0' && isDigit(content[first + 1])) ++first;
    if (first == digits) return;
    size_t offset = static_cast<size_t>(content.data() - s_.data());
    edits_.push_back({offset, content.size(), std::string(content.substr(0, digits)) + std::string(content.substr(first))});
  }

  bool document() {
    size_t start = pos_;
    Tag tag;
    if (!readTag(&tag)) return false;
    if (tag.closing) return fail("</" + std::string(tag.name) + "> without a start tag");
    if (tag.name != "plist") {
      pos_ = start;  // a root value without the <plist> element
      return value(0);
    }
    if (tag.empty) return fail("<plist> holds no value");
    if (!skipMisc()) return false;
    if (startsWith("</")) return fail("<plist> holds no value");
    if (!value(0) || !skipMisc()) return false;
    if (atEnd()) return fail("missing </plist>");
    return expectClosing("plist");
  }

  bool value(int depth) {
    if (depth > kMaxNestingDepth) return fail("nesting deeper than " + std::to_string(kMaxNestingDepth) + " levels");
    Tag tag;
    if (!readTag(&tag)) return false;
    if (tag.closing) return fail("</" + std::string(tag.name) + "> where a value was expected");
    const std::string_view name = tag.name;
    if (name == "dict") return dictionary(tag, depth);
    if (name == "array") return array(tag, depth);
    if (name == "true" || name == "false") return boolean(tag);
    if (name == "key") return fail("<key> outside a dictionary");
    std::string text;
    if (name == "string") return leafText(tag, &text);
    if (name != "integer" && name != "real" && name != "date" && name != "data") {
      return fail("unknown element <" + std::string(name) + ">");
    }
    std::string_view raw;
    if (!leafText(tag, &text, &raw)) return false;
    std::string_view content = trim(text);
    bool valid = name == "integer" ? isIntegerText(content)
                 : name == "real"  ? isRealText(content)
                 : name == "date"  ? isDateText(content)
                                   : isBase64Text(content);
    if (!valid) {
      static constexpr size_t kQuotedTextLimit = 40;
      return fail(std::string(name) + " element holds \"" + std::string(content.substr(0, kQuotedTextLimit)) +
                  "\", which is not valid");
    }
    if (name == "integer") noteLeadingZeros(raw);
    return true;
  }

  bool boolean(const Tag& tag) {
    std::string text;
    if (!leafText(tag, &text)) return false;
    if (!trim(text).empty()) return fail("<" + std::string(tag.name) + "> with content");
    return true;
  }

  bool dictionary(const Tag& tag, int depth) {
    if (tag.empty) return true;
    for (;;) {
      if (!skipMisc()) return false;
      if (startsWith("</")) return expectClosing("dict");
      Tag key;
      if (!readTag(&key)) return false;
      if (key.closing || key.name != "key") {
        return fail("<" + std::string(key.name) + "> in a dictionary where <key> was expected");
      }
      std::string keyText;
      if (!leafText(key, &keyText) || !skipMisc()) return false;
      if (atEnd() || startsWith("</")) return fail("dictionary key \"" + keyText + "\" has no value");
      if (!value(depth + 1)) return false;
    }
  }

  bool array(const Tag& tag, int depth) {
    if (tag.empty) return true;
    for (;;) {
      if (!skipMisc()) return false;
      if (startsWith("</")) return expectClosing("array");
      if (!value(depth + 1)) return false;
    }
  }

  // The document with the noted edits applied, or "" when there are none.
  std::string rewritten() const {
    std::string out;
    if (edits_.empty()) return out;
    size_t copied = 0;
    for (const Edit& edit : edits_) {
      out.append(s_.substr(copied, edit.offset - copied));
      out.append(edit.replacement);
      copied = edit.offset + edit.length;
    }
    out.append(s_.substr(copied));
    return out;
  }

  // A replacement of document bytes; edits are noted in document order.
  struct Edit {
    size_t offset;
    size_t length;
    std::string replacement;
  };

  std::string_view s_;
  size_t pos_ = 0;
  std::string problem_;
  size_t problemOffset_ = 0;
  std::vector<Edit> edits_;
};

}  // namespace

XMLCheck checkXMLPropertyList(std::string_view text) { return Checker(text).run(); }

}  // namespace platform::plist::detail
