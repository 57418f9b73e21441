#pragma once

#include <chrono>
#include <cstddef>
#include <string>
#include <vector>

namespace rolvane::davacl {

// A connection on which nobody has signed in.
struct Newcomer {
    std::string address;
    size_t most = 0;   // of this address, where it came in
    bool busy = false; // it is being answered, or has said something that nobody has read yet
    std::chrono::steady_clock::time_point heard = {};
};

// A client that wants something may be as slow as this between two messages, on a machine that has much to do.
constexpr auto kPatience = std::chrono::seconds(10);
// The same while one address has more than twice its bound.
constexpr auto kShortPatience = std::chrono::seconds(1);

// Which newcomers to close so that no address has more than its bound, as their places in `all`: the longest silent of
// an address first. None is closed before it has been silent for kPatience; kShortPatience where the address has more
// than twice its bound.
std::vector<size_t> surplusOf(const std::vector<Newcomer>& all, std::chrono::steady_clock::time_point now);

} // namespace rolvane::davacl
