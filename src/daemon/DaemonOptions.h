#pragma once

#include <array>

namespace rolvane {

// What RolvaneManager's arguments can be; it ignores every other one.
struct DaemonOption {
    const char* name;
    const char* help;
};
inline constexpr DaemonOption kEndWhenIdle{"-p", "End as soon as it is idle: one pass, and no more"};
inline constexpr std::array kDaemonOptions{kEndWhenIdle};

} // namespace rolvane
