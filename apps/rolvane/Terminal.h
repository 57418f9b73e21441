#pragma once

#include <string>

namespace rolvane::cli {

// A line of standard input; on a terminal it is asked for with the prompt and not shown while it is typed.
std::string readSecret(const std::string& prompt);

} // namespace rolvane::cli
