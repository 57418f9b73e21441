#pragma once

#include <string>

namespace rolvane::cli {

// "Importing [####      ]  40% friends.vcf": one line that is shorter than the terminal, so that it never wraps. In a
// narrow one the note is cut first, then the bar, then the label. No columns: those of an ordinary terminal. A pure
// function; label and note are safe to show.
std::string progressLine(const std::string& label, int percent, const std::string& note, size_t columns);

} // namespace rolvane::cli
