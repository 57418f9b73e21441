#pragma once

#include <fmt/format.h>
#include <string>
#include <string_view>

namespace rolvane::cli {

// "1 person", "2 people".
template <class Number>
std::string counted(Number count, std::string_view one, std::string_view more) {
    return fmt::format("{} {}", count, count == 1 ? one : more);
}

} // namespace rolvane::cli
