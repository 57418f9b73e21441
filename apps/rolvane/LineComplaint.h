#pragma once

#include <string>

namespace rolvane::cli {

// What is wrong with a command line, in the person's language and without a full stop. `said`: the sentence of the
// library that reads the line. A sentence of another kind comes back as it is.
std::string complaintAboutLine(const std::string& said);

} // namespace rolvane::cli
