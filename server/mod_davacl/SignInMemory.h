#pragma once

#include <array>
#include <atomic>
#include <cstddef>
#include <cstdint>
#include <string_view>

namespace rolvane::davacl {

// Remembers which user has shown which password, so that a slow hash is checked once and not at every request. All
// processes of a server share it: it lies in memory that is mapped before they are forked. Any thread; nothing waits.
//
// It holds neither passwords nor what could be tried out elsewhere: of each sign-in 32 bytes, the HMAC-SHA256 of user,
// line of the password file and password, under a random key that lives as long as the mapping. Another line, and no
// line, is therefore another sign-in: whoever changes or removes a password need not tell anybody. A full table
// forgets old entries, who then are checked in full again.
class SignInMemory {
public:
    static SignInMemory* map(); // null when there is no memory or no random number
    void unmap();

    using Mark = std::array<uint64_t, 4>;
    // The line is what the password file has of the user at this moment.
    Mark markOf(std::string_view user, std::string_view line, std::string_view password) const;
    bool knows(const Mark& mark) const;
    void remember(const Mark& mark);

private:
    SignInMemory() = default;
    static constexpr size_t kSets = 1024, kWays = 8;
    using Slot = std::array<std::atomic<uint64_t>, 4>;
    static bool holds(const Slot& slot, const Mark& mark);

    std::array<unsigned char, 32> _key{};
    std::array<std::array<Slot, kWays>, kSets> _sets{};
    std::array<std::atomic<uint32_t>, kSets> _next{}; // the slot of a set that is given away next
};

} // namespace rolvane::davacl
