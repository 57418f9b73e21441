#pragma once

#include <string>

namespace rolvane::cli {

// The fault of a command line, in the person's language and without a full stop. `said` is the English sentence of
// the library that reads the line. An unknown sentence comes back as it is.
std::string complaintAboutLine(const std::string& said);

} // namespace rolvane::cli
