#include "Platform/Foundation/PropertyListCheck.h"

#include <algorithm>
#include <cstdint>
#include <cstdlib>
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

// A decimal or hexadecimal floating-point number, or nan/inf/infinity with
// an optional sign, as strtod reads them; the whole text must be consumed.
bool isRealText(std::string_view t) {
  if (t.empty()) return false;
  std::string copy(t);
  char* end = nullptr;
  (void)std::strtod(copy.c_str(), &end);
  return end == copy.c_str() + copy.size();
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

namespace {

// The binary layout: an 8-byte header, objects, a table of object offsets
// and a 32-byte trailer that says where the table is and how wide its
// entries and the object references are. Numbers are big-endian.
constexpr size_t kBinaryTrailerSize = 32;
constexpr size_t kTrailerOffsetSizeAt = 6;
constexpr size_t kTrailerRefSizeAt = 7;
constexpr size_t kTrailerObjectCountAt = 8;
constexpr size_t kTrailerTopObjectAt = 16;
constexpr size_t kTrailerOffsetTableAt = 24;
constexpr uint8_t kMarkerInteger = 0x1;
constexpr uint8_t kMarkerASCIIString = 0x5;
constexpr uint8_t kMarkerUTF16String = 0x6;
constexpr uint8_t kMarkerArray = 0xA;
constexpr uint8_t kMarkerSet = 0xC;
constexpr uint8_t kMarkerDictionary = 0xD;
constexpr uint8_t kMarkerExtendedLength = 0xF;

class BinaryScanner {
 public:
  explicit BinaryScanner(std::string_view bytes)
      : b_(reinterpret_cast<const uint8_t*>(bytes.data())), size_(bytes.size()) {}

  std::optional<std::string> run() {
    if (size_ < kBinaryTrailerSize) return std::nullopt;
    end_ = size_ - kBinaryTrailerSize;
    const uint8_t* trailer = b_ + end_;
    offsetSize_ = trailer[kTrailerOffsetSizeAt];
    refSize_ = trailer[kTrailerRefSizeAt];
    objectCount_ = bigEndian(trailer + kTrailerObjectCountAt, sizeof(uint64_t));
    offsetTable_ = bigEndian(trailer + kTrailerOffsetTableAt, sizeof(uint64_t));
    if (offsetSize_ < 1 || offsetSize_ > 8 || refSize_ < 1 || refSize_ > 8 || offsetTable_ >= end_ ||
        objectCount_ > (end_ - offsetTable_) / offsetSize_) {
      return std::nullopt;
    }
    for (uint64_t i = 0; i < objectCount_; ++i) {
      if (stringHasNUL(i)) return std::string("a string holds a NUL character");
    }
    return checkShape(bigEndian(trailer + kTrailerTopObjectAt, sizeof(uint64_t)));
  }

 private:
  static uint64_t bigEndian(const uint8_t* p, size_t width) {
    uint64_t v = 0;
    for (size_t i = 0; i < width; ++i) v = (v << 8) | p[i];
    return v;
  }

  std::optional<uint64_t> offsetOf(uint64_t index) const {
    if (index >= objectCount_) return std::nullopt;
    uint64_t offset = bigEndian(b_ + offsetTable_ + index * offsetSize_, offsetSize_);
    if (offset >= end_) return std::nullopt;
    return offset;
  }

  // The element count of the object at `offset` and where its contents
  // start: the marker's low nibble, or an integer object after it.
  bool readCount(uint64_t offset, uint64_t* count, uint64_t* contents) const {
    uint8_t info = b_[offset] & 0xF;
    *contents = offset + 1;
    *count = info;
    if (info != kMarkerExtendedLength) return true;
    if (*contents >= end_ || (b_[*contents] >> 4) != kMarkerInteger) return false;
    uint64_t width = uint64_t{1} << (b_[*contents] & 0xF);
    if (width > sizeof(uint64_t) || *contents + 1 + width > end_) return false;
    *count = bigEndian(b_ + *contents + 1, width);
    *contents += 1 + width;
    return true;
  }

  bool stringHasNUL(uint64_t index) const {
    std::optional<uint64_t> offset = offsetOf(index);
    if (!offset) return false;
    uint8_t type = b_[*offset] >> 4;
    uint64_t count = 0, start = 0;
    if ((type != kMarkerASCIIString && type != kMarkerUTF16String) || !readCount(*offset, &count, &start)) {
      return false;
    }
    uint64_t unit = type == kMarkerUTF16String ? 2 : 1;
    if (count > (end_ - start) / unit) return false;
    for (uint64_t i = 0; i < count; ++i) {
      const uint8_t* c = b_ + start + i * unit;
      if (c[0] == 0 && (unit == 1 || c[1] == 0)) return true;
    }
    return false;
  }

  // The references of a container object: where they start and how many
  // there are (a dictionary has its keys' and then its values'). False for
  // any other object.
  bool references(uint64_t index, uint64_t* start, uint64_t* count) const {
    std::optional<uint64_t> offset = offsetOf(index);
    if (!offset) return false;
    uint8_t type = b_[*offset] >> 4;
    if ((type != kMarkerArray && type != kMarkerSet && type != kMarkerDictionary) ||
        !readCount(*offset, count, start)) {
      return false;
    }
    if (type == kMarkerDictionary) *count *= 2;
    return *start <= end_ && *count <= (end_ - *start) / refSize_;
  }

  uint64_t reference(uint64_t start, uint64_t k) const { return bigEndian(b_ + start + k * refSize_, refSize_); }

  // libplist reads a shared object once for every reference to it and
  // recurses once per level, so a small document can describe an
  // exponentially large tree or overflow the stack. Walks the object graph
  // from the top object without recursion, with each object's depth and
  // expanded size computed once.
  std::optional<std::string> checkShape(uint64_t top) const {
    if (top >= objectCount_) return std::nullopt;
    enum : uint8_t { kUnvisited, kOnPath, kDone };
    std::vector<uint8_t> state(objectCount_, kUnvisited);
    std::vector<uint32_t> depth(objectCount_, 1);
    std::vector<uint64_t> size(objectCount_, 1);
    struct Frame {
      uint64_t index;
      uint64_t next = 0;
    };
    std::vector<Frame> path{{top}};
    state[top] = kOnPath;
    while (!path.empty()) {
      Frame& frame = path.back();
      uint64_t start = 0, count = 0;
      const bool container = references(frame.index, &start, &count);
      if (container && frame.next < count) {
        uint64_t child = reference(start, frame.next++);
        if (child >= objectCount_ || state[child] == kDone) continue;
        if (state[child] == kOnPath) return std::string("a container that contains itself");
        if (path.size() > static_cast<size_t>(kMaxNestingDepth)) return deeperThanLimit();
        state[child] = kOnPath;
        path.push_back({child});
        continue;
      }
      for (uint64_t k = 0; container && k < count; ++k) {
        uint64_t child = reference(start, k);
        if (child >= objectCount_) continue;
        depth[frame.index] = std::max(depth[frame.index], depth[child] + 1);
        size[frame.index] = std::min(kMaxExpandedObjects + 1, size[frame.index] + size[child]);
      }
      if (depth[frame.index] > static_cast<uint32_t>(kMaxNestingDepth) + 1) return deeperThanLimit();
      if (size[frame.index] > kMaxExpandedObjects) {
        return "shared objects that expand to more than " + std::to_string(kMaxExpandedObjects) + " values";
      }
      state[frame.index] = kDone;
      path.pop_back();
    }
    return std::nullopt;
  }

  static std::string deeperThanLimit() {
    return "nesting deeper than " + std::to_string(kMaxNestingDepth) + " levels";
  }

  const uint8_t* b_;
  size_t size_;
  uint64_t end_ = 0;
  uint64_t offsetSize_ = 0;
  uint64_t refSize_ = 0;
  uint64_t objectCount_ = 0;
  uint64_t offsetTable_ = 0;
};

}  // namespace

std::optional<std::string> checkBinaryPropertyList(std::string_view bytes) { return BinaryScanner(bytes).run(); }

}  // namespace platform::plist::detail
