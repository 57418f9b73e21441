#pragma once

#ifdef ROLVANE_TEST_SWITCHES
#include <cstdlib>
#include <string_view>
#endif

namespace rolvane {

// Asks whether a test wants to do without one part of the program, to see that something notices. The sources that ask
// are compiled twice: as they are released, where the answer is a constant and nothing of the question is left, and for
// the tests (tests/switches), where the environment variable ROLVANE_LEFT_OUT names the part. Any thread.
#ifdef ROLVANE_TEST_SWITCHES
inline bool isLeftOut(std::string_view part) {
    const char* leftOut = std::getenv("ROLVANE_LEFT_OUT");
    return leftOut && part == leftOut;
}
#else
constexpr bool isLeftOut(const char*) {
    return false;
}
#endif

} // namespace rolvane
