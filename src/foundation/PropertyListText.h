#pragma once

#include <string>
#include <string_view>

namespace rolvane {

// What stands before the XML parser of property lists: gives the text as UTF-8 without byte order mark, held in
// `converted` when it was UTF-16, else in `text` itself. Throws kCXPropertyListException with line and reason for what
// the parser would take too lightly or too slowly: encodings other than UTF-8, ASCII and marked UTF-16, zero bytes,
// and tags longer than 512 bytes (the parser compares every attribute of a tag with every other).
std::string_view preparePropertyListText(std::string_view text, std::string& converted);

} // namespace rolvane
