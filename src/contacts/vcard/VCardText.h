#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace rolvane {

// Character and transfer encodings of vCard files. Pure functions, any thread.

// The offset of the first byte that does not belong to well-formed UTF-8 (RFC 3629: no surrogates, no overlong forms),
// or nothing when all of it is.
std::optional<size_t> vcardFirstInvalidUTF8(std::string_view text);

// True when the text has a control character that a text value cannot carry: U+0000 to U+001F without tab and line
// feed, U+007F, U+FFFE, U+FFFF (XML 1.0 has no form for most of them).
bool vcardHasControlCharacter(std::string_view text);

// Decoding of RFC 2045 section 6.8. White space is ignored, missing padding is tolerated, anything else is damage:
// nothing is returned.
std::optional<std::vector<uint8_t>> vcardDecodeBase64(std::string_view text);
std::string vcardEncodeBase64(const std::vector<uint8_t>& bytes);

// Decoding of RFC 2045 section 6.7 without soft line breaks (the reader joins those). A "=" that no two hexadecimal
// digits follow stands for itself.
std::string vcardDecodeQuotedPrintable(std::string_view text);

// RFC 3986 percent-decoding, for data: URIs that are not base64.
std::string vcardDecodePercent(std::string_view text);

// The text in UTF-8, or nothing when the character set is unknown or the bytes are not of it.
std::optional<std::string> vcardConvertToUTF8(std::string_view text, const std::string& charset);

// ASCII only, as names in vCards are compared.
bool vcardEqualNoCase(std::string_view a, std::string_view b);
std::string vcardUpper(std::string_view s);
std::string vcardLower(std::string_view s);
std::string_view vcardTrim(std::string_view s); // spaces and tabs at both ends

} // namespace rolvane
