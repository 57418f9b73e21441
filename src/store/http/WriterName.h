#pragma once

#include <string>
#include <string_view>

namespace rolvane {

// What this process's changes are known by on a store that tells news, so that they are no news to itself: a random
// text, another one in each run, sent with every request that may change something. Any thread.
inline constexpr const char* kWriterHeader = "Rolvane-Writer";
const std::string& writerName();
// Whether a request with this method is sent with it.
bool namesItsWriter(std::string_view method);

} // namespace rolvane
