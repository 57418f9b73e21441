#pragma once

#include <optional>
#include <string>

namespace rolvane::cli {

// A line of standard input; on a terminal it is asked for with the prompt and not shown while it is typed.
std::string readSecret(const std::string& prompt);

size_t terminalColumns(int descriptor); // 0 when it is no terminal, or one of no known width

// The same shown while it is typed. Nothing at the end of the input.
std::optional<std::string> readLine(const std::string& prompt);

} // namespace rolvane::cli
