#pragma once

#include <array>
#include <atomic>
#include <cstddef>
#include <cstdint>
#include <string_view>

namespace rolvane::davacl {

// Slows down who tries passwords. After kFreeTries wrong ones from one address for one user, no password from there is
// looked at for a second, and for twice the time after each further wrong one, a minute at most. Ten minutes without a
// wrong one, or a right one, and all is forgotten. A guess that comes in a pause is refused unread: it costs no hash
// and makes no thread wait. Guesses at the same moment count before their hashes are computed. All processes of a
// server share it: it lies in memory that is mapped before they are forked. Any thread; nothing waits. A random key
// says which places share a set of slots, so nobody can choose names that push another one out; in a full set the
// oldest gives way.
class SignInBrake {
public:
    static constexpr uint32_t kFreeTries = 5;
    static constexpr int64_t kFirstPause = 1000, kLongestPause = 60000, kForgotten = 600000; // milliseconds
    static constexpr int64_t kLongestLook = 10000; // whoever looks for longer has died

    static SignInBrake* map(); // null when there is no memory or no random number
    void unmap();

    // One number for a user and an address: the address's bytes, of an IPv6 address the first eight.
    static uint64_t place(std::string_view user, std::string_view address);

    // `now` is in milliseconds of a clock that never goes back.
    bool looks(uint64_t place, int64_t now);    // false in a pause; else `wrong` or `right` follows
    int64_t wrong(uint64_t place, int64_t now); // the pause that begins with it; 0 for none
    void right(uint64_t place);

private:
    SignInBrake() = default;
    struct Slot {
        std::atomic<uint64_t> place{0};
        std::atomic<uint32_t> wrong{0}, looking{0};
        std::atomic<int64_t> last{0}, until{0}, looked{0};
    };
    static constexpr size_t kSets = 512, kWays = 8;
    Slot& slotOf(uint64_t place, int64_t now);

    std::array<uint64_t, 2> _key{};
    std::array<std::array<Slot, kWays>, kSets> _sets{};
};

} // namespace rolvane::davacl
