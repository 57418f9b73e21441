#pragma once

#include <string>

namespace rolvane::cli {

// The examples of a command, two blanks before each line; "" for none. `path` as below.
std::string exampleOf(const std::string& path);
// The end of a command's help: examples of it, and where the exit codes are told. `path` is the command's name with its
// parents' before it, "group add".
std::string helpFooter(const std::string& path);

} // namespace rolvane::cli
