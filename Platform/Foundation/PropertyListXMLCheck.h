// Structural check of an XML property-list document.
//
// libplist's XML reader lets malformed documents through: an integer element
// whose text is not a number reads as 0, a dictionary key without a value is
// dropped, text after the root and a missing "</plist>" are ignored. This
// check runs before libplist sees the text and refuses such documents. It
// accepts everything a well-formed property list may hold: an XML declaration,
// a document type declaration (with an internal subset), comments, processing
// instructions, CDATA sections, character and the predefined entity
// references, attributes, empty-element tags, and a root value with or
// without the enclosing <plist> element.
//
// Internal to the property-list reader. Thread safety: pure function.
#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace platform::plist::detail {

// Deepest nesting of arrays and dictionaries that a document may have; deeper
// documents are refused before any recursive reader sees them.
inline constexpr int kMaxNestingDepth = 512;

// Checks `text` (without a byte-order mark). Returns none when the document is
// a well-formed property list, otherwise what is wrong and where ("integer
// element holds \"abc\", not a number (byte 120)").
std::optional<std::string> checkXMLPropertyList(std::string_view text);

}  // namespace platform::plist::detail
