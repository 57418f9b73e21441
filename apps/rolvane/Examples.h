#pragma once

#include <string>

namespace rolvane::cli {

// The end of a command's help: examples of it, and where the exit codes are told. `path` is the command's name with its
// parents' before it, "group add".
std::string helpFooter(const std::string& path);

} // namespace rolvane::cli
