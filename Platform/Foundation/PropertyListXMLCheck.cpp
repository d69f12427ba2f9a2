// The XML half of PropertyListCheck.h: expat reads the XML, the handlers
// below hold what it reports to the property-list subset.
#include "Platform/Foundation/PropertyListCheck.h"

#include <expat.h>

#include <algorithm>
#include <charconv>
#include <climits>
#include <cstdint>
#include <memory>
#include <system_error>
#include <vector>

namespace platform::plist::detail {

namespace {

constexpr std::string_view kWhitespace = " \t\r\n";
constexpr std::string_view kBase64Characters =
    "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/= \t\r\n";

// libplist reads the bytes of a document as they are, whatever encoding it
// declares, and the XML writer keeps strings that are not UTF-8 as they are.
// So expat is told that the document is in an encoding of our own, in which
// ASCII is itself and every other byte (and every control byte, which XML
// does not allow) is one character of a private-use block; the text handlers
// turn those characters back into the bytes they stand for.
constexpr char kByteEncoding[] = "x-quillset-bytes";
constexpr uint32_t kRawByteBase = 0xF700;  // byte b reads as U+F700 + b
// expat takes at most INT_MAX bytes a call.
constexpr size_t kParseChunk = size_t{1} << 30;

bool isSpace(char c) {
  return kWhitespace.find(c) != std::string_view::npos;
}
bool isDigit(char c) {
  return c >= '0' && c <= '9';
}
bool isHexDigit(char c) {
  return isDigit(c) || (c >= 'a' && c <= 'f') || (c >= 'A' && c <= 'F');
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

bool isBase64Text(std::string_view t) {
  return t.find_first_not_of(kBase64Characters) == std::string_view::npos;
}

enum class Element { Plist, Dict, Array, Key, True, False, String, Integer, Real, Date, Data };

constexpr std::pair<std::string_view, Element> kElements[] = {
    {"plist", Element::Plist}, {"dict", Element::Dict},   {"array", Element::Array},   {"key", Element::Key},
    {"true", Element::True},   {"false", Element::False}, {"string", Element::String}, {"integer", Element::Integer},
    {"real", Element::Real},   {"date", Element::Date},   {"data", Element::Data},
};

std::optional<Element> elementNamed(std::string_view name) {
  for (const auto& [elementName, element] : kElements) {
    if (elementName == name) return element;
  }
  return std::nullopt;
}

bool isContainer(Element e) {
  return e == Element::Plist || e == Element::Dict || e == Element::Array;
}

int XMLCALL byteEncoding(void*, const XML_Char* name, XML_Encoding* info) {
  if (std::string_view(name) != kByteEncoding) return XML_STATUS_ERROR;
  for (int b = 0; b < 256; ++b) {
    const bool xmlCharacter = (b >= 0x20 && b < 0x80) || b == '\t' || b == '\n' || b == '\r';
    info->map[b] = xmlCharacter ? b : static_cast<int>(kRawByteBase) + b;
  }
  info->data = nullptr;
  info->convert = nullptr;
  info->release = nullptr;
  return XML_STATUS_OK;
}

// Appends UTF-8 `text` that expat reported to *out; with `restoreBytes`, the
// characters that stand for document bytes become those bytes again (a
// character reference means the character it names, even one of that block).
void appendText(std::string_view text, bool restoreBytes, std::string* out) {
  for (size_t i = 0; i < text.size();) {
    // U+F700 to U+F7FF are EF 9C 80 to EF 9F BF.
    const auto lead = static_cast<unsigned char>(text[i]);
    if (restoreBytes && lead == 0xEF && i + 2 < text.size()) {
      const uint32_t c = ((lead & 0x0Fu) << 12) | ((static_cast<unsigned char>(text[i + 1]) & 0x3Fu) << 6) |
                         (static_cast<unsigned char>(text[i + 2]) & 0x3Fu);
      if (c >= kRawByteBase && c <= kRawByteBase + 0xFF) {
        *out += static_cast<char>(c - kRawByteBase);
        i += 3;
        continue;
      }
    }
    *out += text[i++];
  }
}

// Holds expat's events to the property-list subset and records the first
// problem it meets, after which the parser is stopped.
class Checker {
 public:
  explicit Checker(std::string_view text) : s_(text) {}

  XMLCheck run() {
    if (trim(s_).empty()) return {std::string("the document is empty"), {}};
    if (size_t nul = s_.find('\0'); nul != std::string_view::npos) {
      return {"a NUL character (byte " + std::to_string(nul) + ")", {}};
    }
    std::unique_ptr<XML_ParserStruct, decltype(&XML_ParserFree)> parser(XML_ParserCreate(kByteEncoding),
                                                                        XML_ParserFree);
    if (!parser) return {std::string("out of memory for the XML reader"), {}};
    parser_ = parser.get();
    XML_SetUnknownEncodingHandler(parser_, byteEncoding, nullptr);
    XML_SetUserData(parser_, this);
    XML_SetElementHandler(parser_, &Checker::onStart, &Checker::onEnd);
    XML_SetCharacterDataHandler(parser_, &Checker::onText);
    XML_SetCdataSectionHandler(parser_, &Checker::onCDATAStart, &Checker::onCDATAEnd);
    // A default handler turns off the expansion of internal entities; their
    // references, and those of undeclared entities, reach the skipped-entity
    // handler, which refuses them. External entities are never read.
    XML_SetDefaultHandler(parser_, [](void*, const XML_Char*, int) {});
    XML_SetSkippedEntityHandler(parser_, &Checker::onSkippedEntity);
    XML_SetExternalEntityRefHandler(parser_, &Checker::onExternalEntity);
    XML_SetParamEntityParsing(parser_, XML_PARAM_ENTITY_PARSING_NEVER);

    XML_Status status = XML_STATUS_OK;
    for (size_t done = 0; status == XML_STATUS_OK && done < s_.size();) {
      const size_t length = std::min(kParseChunk, s_.size() - done);
      status = XML_Parse(parser_, s_.data() + done, static_cast<int>(length), done + length == s_.size());
      done += length;
    }
    if (status != XML_STATUS_OK && problem_.empty()) parseError();
    if (problem_.empty()) return {std::nullopt, rewritten()};
    return {problem_ + " (byte " + std::to_string(problemOffset_) + ")", {}};
  }

 private:
  struct Frame {
    Element element;
    std::string text;         // a leaf's text; a dictionary's key that waits for its value
    bool holdsValue = false;  // <plist>: its value has begun; a dictionary: a key waits for its value
    size_t contentStart = 0;  // byte offset just past the start tag
  };

  static Checker& self(void* data) { return *static_cast<Checker*>(data); }
  size_t offset() const {
    const XML_Index index = XML_GetCurrentByteIndex(parser_);
    return index < 0 ? s_.size() : static_cast<size_t>(index);
  }

  void fail(std::string message, std::optional<size_t> at = std::nullopt) {
    if (!problem_.empty()) return;
    problem_ = std::move(message);
    problemOffset_ = at ? *at : offset();
    (void)XML_StopParser(parser_, XML_FALSE);  // fails only when parsing already ended
  }

  // What expat itself refused, in the words the handlers use where they apply.
  void parseError() {
    const size_t at = offset();
    switch (XML_GetErrorCode(parser_)) {
      case XML_ERROR_NO_ELEMENTS:
      case XML_ERROR_UNCLOSED_TOKEN:
      case XML_ERROR_PARTIAL_CHAR:
      case XML_ERROR_UNCLOSED_CDATA_SECTION:
        if (stack_.size() == 1 && stack_[0].element == Element::Plist && stack_[0].holdsValue) {
          return fail("missing </plist>", s_.size());
        }
        return fail("unexpected end of the document", s_.size());
      case XML_ERROR_JUNK_AFTER_DOC_ELEMENT:
        return fail("content after the end of the property list", at);
      case XML_ERROR_UNDEFINED_ENTITY: {
        static constexpr size_t kNameLimit = 40;
        const size_t semicolon = s_.find(';', at);
        const size_t length = semicolon == std::string_view::npos ? kNameLimit : semicolon - at - 1;
        return fail(entityProblem(s_.substr(at + 1, std::min(length, kNameLimit))), at);
      }
      default:
        return fail(std::string("malformed XML: ") + XML_ErrorString(XML_GetErrorCode(parser_)), at);
    }
  }

  static std::string entityProblem(std::string_view name) {
    return "entity reference &" + std::string(name) + "; (only the predefined entities are read)";
  }

  static void XMLCALL onSkippedEntity(void* data, const XML_Char* name, int isParameterEntity) {
    if (!isParameterEntity) self(data).fail(entityProblem(name));
  }

  static int XMLCALL onExternalEntity(XML_Parser parser, const XML_Char*, const XML_Char*, const XML_Char*,
                                      const XML_Char*) {
    self(XML_GetUserData(parser)).fail("a reference to an external entity");
    return XML_STATUS_ERROR;
  }

  static void XMLCALL onStart(void* data, const XML_Char* name, const XML_Char**) { self(data).start(name); }
  static void XMLCALL onEnd(void* data, const XML_Char*) { self(data).end(); }
  static void XMLCALL onText(void* data, const XML_Char* text, int length) {
    self(data).text(std::string_view(text, static_cast<size_t>(length)));
  }
  static void XMLCALL onCDATAStart(void* data) { self(data).cdataStart(); }
  static void XMLCALL onCDATAEnd(void* data) { self(data).inCDATA_ = false; }

  // expat may report an event or two after the parser was stopped; they are
  // ignored.
  void start(std::string_view name) {
    if (!problem_.empty()) return;
    const std::optional<Element> element = elementNamed(name);
    const std::string tag = "<" + std::string(name) + ">";
    if (!element || (*element == Element::Plist && !stack_.empty())) return fail("unknown element " + tag);
    if (stack_.empty() && *element == Element::Key) return fail("<key> outside a dictionary");
    if (!stack_.empty()) {
      Frame& parent = stack_.back();
      if (!isContainer(parent.element)) {
        return fail(tag + " where </" + std::string(nameOf(parent.element)) + "> was expected");
      }
      if (parent.element == Element::Plist && parent.holdsValue) return fail(tag + " where </plist> was expected");
      if (parent.element == Element::Dict && !parent.holdsValue && *element != Element::Key) {
        return fail(tag + " in a dictionary where <key> was expected");
      }
      if (parent.element == Element::Dict && parent.holdsValue && *element == Element::Key) {
        return fail(keyWithoutValue(parent));
      }
      if (parent.element != Element::Dict && *element == Element::Key) return fail("<key> outside a dictionary");
      if (parent.element == Element::Plist) parent.holdsValue = true;
      if (parent.element == Element::Dict) parent.holdsValue = false;  // a key begins, or the waiting one has its value
    }
    if (containers_ > kMaxNestingDepth) {
      return fail("nesting deeper than " + std::to_string(kMaxNestingDepth) + " levels");
    }
    if (*element == Element::Dict || *element == Element::Array) ++containers_;
    stack_.push_back({*element, {}, false, offset() + static_cast<size_t>(XML_GetCurrentByteCount(parser_))});
  }

  void end() {
    if (!problem_.empty() || stack_.empty()) return;
    Frame frame = std::move(stack_.back());
    stack_.pop_back();
    const std::string_view name = nameOf(frame.element);
    const std::string_view content = trim(frame.text);
    switch (frame.element) {
      case Element::Plist:
        if (!frame.holdsValue) fail("<plist> holds no value");
        return;
      case Element::Dict:
        if (frame.holdsValue) fail(keyWithoutValue(frame));
        [[fallthrough]];
      case Element::Array:
        --containers_;
        return;
      case Element::Key:
        stack_.back().text = std::move(frame.text);
        stack_.back().holdsValue = true;
        return;
      case Element::True:
      case Element::False:
        if (!content.empty()) fail("<" + std::string(name) + "> with content");
        return;
      case Element::String:
        return;
      case Element::Integer:
      case Element::Real:
      case Element::Date:
      case Element::Data:
        break;
    }
    const bool valid = frame.element == Element::Integer ? isIntegerText(content)
                       : frame.element == Element::Real  ? isRealText(content)
                       : frame.element == Element::Date  ? isDateText(content)
                                                         : isBase64Text(content);
    if (!valid) {
      static constexpr size_t kQuotedTextLimit = 40;
      return fail(std::string(name) + " element holds \"" + std::string(content.substr(0, kQuotedTextLimit)) +
                  "\", which is not valid");
    }
    noteCanonicalText(frame.element, content, frame.contentStart, offset());
  }

  void text(std::string_view text) {
    if (!problem_.empty() || stack_.empty()) return;
    Frame& frame = stack_.back();
    if (!isContainer(frame.element)) {
      // A reference is reported on its own, as the character it names.
      const size_t at = offset();
      appendText(text, inCDATA_ || at >= s_.size() || s_[at] != '&', &frame.text);
    } else if (!trim(text).empty()) {
      fail("text where an element was expected");
    }
  }

  void cdataStart() {
    if (!stack_.empty() && isContainer(stack_.back().element)) return fail("text where an element was expected");
    inCDATA_ = true;
  }

  static std::string_view nameOf(Element element) {
    for (const auto& [name, e] : kElements) {
      if (e == element) return name;
    }
    return {};
  }

  static std::string keyWithoutValue(const Frame& dictionary) {
    return "dictionary key \"" + dictionary.text + "\" has no value";
  }

  // libplist reads the text of numbers, dates and data as it stands in the
  // document, so a reference, comment or CDATA section there would be read
  // as something else than what this check read; such text is rewritten as
  // read. It reads integers with strtoull's automatic base, so "010" would be
  // octal 8 and "08" would be 0: a decimal with leading zeros is rewritten
  // without them.
  void noteCanonicalText(Element element, std::string_view content, size_t start, size_t end) {
    std::string canonical(content);
    if (element == Element::Integer) {
      const size_t sign = !content.empty() && (content.front() == '-' || content.front() == '+') ? 1 : 0;
      size_t first = sign;
      while (first + 1 < content.size() && content[first] == '0' && isDigit(content[first + 1])) ++first;
      canonical = std::string(content.substr(0, sign)) + std::string(content.substr(first));
    }
    const std::string_view raw = s_.substr(start, end > start ? end - start : 0);
    if (trim(raw) != canonical) edits_.push_back({start, raw.size(), std::move(canonical)});
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
  XML_Parser parser_ = nullptr;
  std::vector<Frame> stack_;
  int containers_ = 0;  // dictionaries and arrays open
  bool inCDATA_ = false;
  std::string problem_;
  size_t problemOffset_ = 0;
  std::vector<Edit> edits_;
};

}  // namespace

XMLCheck checkXMLPropertyList(std::string_view text) {
  return Checker(text).run();
}

}  // namespace platform::plist::detail
