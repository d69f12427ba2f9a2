// Checks of property-list documents before libplist reads them.
//
// libplist's XML reader lets malformed documents through: an integer element
// whose text is not a number reads as 0, a dictionary key without a value is
// dropped, text after the root and a missing "</plist>" are ignored. This
// check runs before libplist sees the text and refuses such documents. expat
// reads the XML, so everything well-formed XML may hold is accepted: an XML
// declaration, a document type declaration (with an internal subset),
// comments, processing instructions, CDATA sections, character and the
// predefined entity references, attributes, empty-element tags, and a root
// value with or without the enclosing <plist> element. Entities are neither
// expanded nor fetched: a reference to any but the predefined ones is
// refused. Bytes that are not UTF-8 are kept as they are, as libplist reads
// them; a NUL character, which XML does not allow, is refused.
//
// libplist's binary reader aborts the process (a failed assertion) when
// asked for a dictionary key that holds a NUL character (and cuts other
// strings short at one), overflows the stack
// on deep nesting and expands every shared object once per reference. The
// binary check refuses such documents first.
//
// Internal to the property-list reader. Thread safety: pure function.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace platform::plist::detail {

// Deepest nesting of arrays and dictionaries that a document may have; deeper
// documents are refused before any recursive reader sees them.
inline constexpr int kMaxNestingDepth = 512;
// Most values a binary document may expand to when its shared objects are
// read once per reference.
inline constexpr uint64_t kMaxExpandedObjects = uint64_t{1} << 22;

struct XMLCheck {
  // None when the document is a well-formed property list, otherwise what is
  // wrong and where ("integer element holds \"abc\", which is not valid
  // (byte 120)").
  std::optional<std::string> problem;
  // The text libplist is to read when it differs from the document: the text
  // of numbers, dates and data that holds references, comments or CDATA
  // sections, rewritten as this check read it, and decimal integers written
  // with leading zeros, which libplist would take for octal ("010" as 8, "08"
  // as 0), rewritten without them. Empty when the document itself will do.
  std::string rewritten;
};

// Checks `text` (without a byte-order mark).
XMLCheck checkXMLPropertyList(std::string_view text);

// Checks a binary ("bplist00") document for strings that hold a NUL
// character, for containers that contain themselves, nesting deeper than
// kMaxNestingDepth and more than kMaxExpandedObjects values in all. Returns
// none when there is none of these; other damage is left for libplist.
std::optional<std::string> checkBinaryPropertyList(std::string_view bytes);

}  // namespace platform::plist::detail
