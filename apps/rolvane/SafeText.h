#pragma once

#include <string>
#include <string_view>

namespace rolvane::cli {

// Make other people's texts safe for a terminal. Characters that steer it or turn the direction of writing are shown as
// escapes, "\u202e". Bytes that are no UTF-8 become U+FFFD. Pure functions.

std::string shownText(std::string_view text); // line feeds and tabs stay
std::string shownLine(std::string_view text); // for a text within a line: those too are escapes
std::string shownJson(std::string_view json); // a document; it says the same

// How many columns of a terminal a text takes, and its beginning that takes no more than `columns`, with "…" when
// something is cut off.
size_t columnsOf(std::string_view text);
std::string cutTo(std::string_view text, size_t columns);

} // namespace rolvane::cli
