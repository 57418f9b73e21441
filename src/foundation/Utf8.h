#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>

namespace rolvane {

// Takes one code point off the front (RFC 3629: no overlong forms, no surrogates, nothing above U+10FFFF). Nothing,
// and `rest` as it was, when what stands there is not UTF-8 or there is nothing left.
std::optional<char32_t> takeCodePoint(std::string_view& rest);
void appendUtf8(char32_t codePoint, std::string& out); // a valid code point

bool isUtf8(std::string_view text);
// The length in UTF-16 units; a byte that is not part of UTF-8 counts as one.
size_t utf16Length(std::string_view text);
// Why the text cannot stand in an XML 1.0 document even when escaped ("it has the control character U+0001"), or
// nothing when it can.
std::optional<std::string> xmlTextFault(std::string_view text);

} // namespace rolvane
