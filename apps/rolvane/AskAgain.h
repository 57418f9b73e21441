#pragma once

#include "Context.h"

#include "engine/pass/StorePatience.h"

#include <chrono>
#include <random>

namespace rolvane::cli {

// A command that asks a store which cannot answer for the moment asks again, and says so. Made before the first
// attempt.
class AskAgain {
public:
    explicit AskAgain(Context& context) : _context(context) {}

    // Pauses after a failure, as StorePatience says. False: the failure is to be told.
    bool after(const PassFailure& failure);

private:
    Context& _context;
    StorePatience _patience;
    std::mt19937 _random{std::random_device()()};
    const std::chrono::steady_clock::time_point _began = std::chrono::steady_clock::now();
};

} // namespace rolvane::cli
