#pragma once

#include "foundation/RunLoop.h"

#include <chrono>
#include <functional>
#include <string>

#include <gtest/gtest.h>

namespace rolvane::test {

// Serves the run loop until the condition holds, for conditions that other processes and threads bring about. Fails
// after the deadline and says what was waited for: EXPECT_TRUE(waitUntil(loop, [&] { return n == 3; }, "three edits")).
inline testing::AssertionResult waitUntil(RunLoop& loop, const std::function<bool()>& condition,
                                          const std::string& what, double timeoutSeconds = 20) {
    auto start = std::chrono::steady_clock::now();
    auto waited = [&] { return std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count(); };
    while (!condition()) {
        if (waited() > timeoutSeconds)
            return testing::AssertionFailure() << "waited " << waited() << " s in vain for: " << what;
        loop.runOnce(0.01);
    }
    return testing::AssertionSuccess();
}

inline testing::AssertionResult waitUntil(const std::function<bool()>& condition, const std::string& what,
                                          double timeoutSeconds = 20) {
    return waitUntil(RunLoop::current(), condition, what, timeoutSeconds);
}

} // namespace rolvane::test
