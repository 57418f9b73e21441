#pragma once

#include <gtest/gtest.h>
#include <string>

namespace rolvane::test {

// Whether systemd finds an exposure of 2.5 at most in the unit's file, and every setting in it is one that a user
// manager applies. Those that it leaves out without a word, or that need rights which no user has, improve the figure
// alone.
testing::AssertionResult isConfined(const std::string& file);

} // namespace rolvane::test
