#pragma once

#include <istream>
#include <optional>
#include <string>
#include <string_view>

namespace rolvane {

// Character sets of text that does not say its own. Pure but for the stream; any thread.

// The character set that bytes which are no UTF-8 are most likely of, as iconv names it: by their statistics, and
// Windows-1252 where those say nothing. Never empty.
std::string detectedCharset(std::string_view sample);

// True when iconv can read the character set.
bool isKnownCharset(const std::string& charset);

// What of a vCard stream, read to its end and wound back, says nothing of its character set and is no UTF-8: lines
// without a CHARSET, quoted-printable resolved; 256 KB at most. "" when there is nothing of the kind.
std::string foreignTextOfCards(std::istream& in);

// The whole text in UTF-8 when its first bytes say that it is UTF-16, else nothing.
std::optional<std::string> textFromUTF16(std::string_view text);
bool beginsAsUTF16(std::string_view start);

} // namespace rolvane
