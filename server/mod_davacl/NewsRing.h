#pragma once

#include <array>
#include <atomic>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace rolvane::davacl {

// The last changes of all trees, in memory that all processes of a server share: it is mapped before they are forked
// and kept over restarts. Any thread of any process; a process that is killed in the middle of a note leaves
// one that is never whole.
//
// A note says which tree and who wrote, both as numbers that nothing can be read from. Positions count the notes. They
// leave the server as tokens alone, which tell nobody how many changes there were in other people's trees.
class NewsRing {
public:
    static NewsRing* map(); // null when there is no memory or no random number

    struct Note {
        uint64_t tree = 0, writer = 0; // writer: 0 for one that gives no name
    };
    static uint64_t numberOf(std::string_view name); // never 0; the start of its SHA-256

    void post(const Note& note);
    uint64_t position() const { return _next.load(std::memory_order_acquire); } // of the next note

    // The notes from a position on, up to the first that is being written.
    struct Notes {
        bool some = true;        // false: notes have been overwritten, so that anything may have changed
        std::vector<Note> notes; // in order
        uint64_t next = 0;       // where to go on
    };
    Notes from(uint64_t position) const;

    uint32_t bell() const { return _bell.load(std::memory_order_acquire); }
    // Returns when the bell is another one than was seen, and now and then before.
    void waitForBell(uint32_t seen, int milliseconds) const;
    void ring(); // wakes whoever waits, with or without a note

    std::string token(uint64_t position) const;
    // Nothing for a text that this ring did not give.
    std::optional<uint64_t> positionOf(std::string_view token) const;

private:
    NewsRing() = default;
    struct Slot {
        std::atomic<uint64_t> number = 0; // its note's position, plus one; 0 while it is being written
        std::atomic<uint64_t> tree = 0, writer = 0;
    };
    // Enough for the first publication of 100,000 people, with two notes for each file: whoever has made it is then
    // told of nothing, and does not list all of it again. 6 MB, shared by all processes.
    static constexpr size_t kSlots = size_t{1} << 18;
    using Block = std::array<unsigned char, 16>;
    std::optional<Block> ciphered(const Block& block, bool encrypts) const;

    uint64_t _epoch = 0;
    std::array<unsigned char, 16> _key{};
    std::atomic<uint64_t> _next = 0;
    std::atomic<uint32_t> _bell = 0;
    std::array<Slot, kSlots> _slots{};
};

} // namespace rolvane::davacl
