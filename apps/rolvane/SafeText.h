#pragma once

#include <string>
#include <string_view>

namespace rolvane::cli {

// Texts of other people on their way to a terminal: what would steer it, or turn the direction of what stands behind,
// is shown as an escape, "\u202e". Bytes that are no UTF-8 become U+FFFD. Pure functions.

std::string shownText(std::string_view text); // line feeds and tabs stay
std::string shownLine(std::string_view text); // for a text within a line: those too are escapes
std::string shownJson(std::string_view json); // a document; it says the same

// How many columns of a terminal a text takes, and its beginning that takes no more than `columns`, with "…" when
// something is cut off.
size_t columnsOf(std::string_view text);
std::string cutTo(std::string_view text, size_t columns);

} // namespace rolvane::cli
