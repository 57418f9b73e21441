#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

namespace rolvane::davacl {

// A thread that waits for a client's network: for bytes of a request, or for room for an answer.
struct SlowThread {
    std::string user;                   // "" before anybody has signed in
    std::chrono::milliseconds waited{}; // in this request
    uint64_t taken = 0;                 // bytes of the answer that the client, or the system for it, has taken
    bool sends = false;                 // it waits for room for an answer
};

// A thread that has waited this long counts as slow. On a machine with much to do, one whose client is quick may stand
// still for parts of a second.
constexpr auto kSlow = std::chrono::milliseconds(1000);

// Which threads to end, as their places in `all`, so that no more than `most` are slow: always the one that has waited
// longest for the user who has most of them. So whoever has few goes on while others have many. Also those whose
// answers are taken away at less than 500 bytes a second, after a minute.
std::vector<size_t> surplusOf(const std::vector<SlowThread>& all, size_t most);

// Whether the user's next request is refused: `most` threads are slow, and the user has a full share of them already.
bool hasShareOf(const std::vector<SlowThread>& all, size_t most, const std::string& user);

} // namespace rolvane::davacl
