#pragma once

#include <string>
#include <vector>

namespace rolvane {

// Runs a program without input or output and waits for it: its exit status, or -1 when it could not be run or was
// ended by a signal. A name without a slash is looked for in PATH. Any thread.
int runQuietly(std::vector<std::string> arguments);

} // namespace rolvane
