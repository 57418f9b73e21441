#pragma once

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <vector>

namespace rolvane {

// An open-addressed table from hashes to numbers, which are places in a list of the caller's; the caller tells which of
// the numbers with a hash is the one. A byte of each hash lies apart: that something is not there, the usual answer in
// a large pass, is seen in a quarter of a megabyte for a hundred thousand numbers, which stays near the processor.
// Nothing is ever removed. One thread at a time.
class NumberTable {
public:
    static constexpr uint32_t kNone = UINT32_MAX;

    // The number with the hash of which `isIt(number)` is true; kNone when there is none.
    template <class IsIt>
    uint32_t find(uint32_t hash, IsIt&& isIt) const {
        if (_slots.empty()) return kNone;
        for (size_t i = hash & mask(); _tags[i] != kFree; i = (i + 1) & mask())
            if (_tags[i] == tagOf(hash) && _slots[i].hash == hash && isIt(_slots[i].number)) return _slots[i].number;
        return kNone;
    }
    // Asks the processor to bring near what find() of the hash needs.
    void prefetch(uint32_t hash) const {
        if (_slots.empty()) return;
        __builtin_prefetch(&_tags[hash & mask()]);
        __builtin_prefetch(&_slots[hash & mask()]);
    }
    void add(uint32_t hash, uint32_t number) {
        if ((_count + 1) * 2 > _slots.size()) grow();
        put({hash, number});
        ++_count;
    }

private:
    struct Slot {
        uint32_t hash = 0, number = kNone;
    };
    static constexpr uint8_t kFree = 0;
    static uint8_t tagOf(uint32_t hash) { return static_cast<uint8_t>(0x80 | (hash >> 25)); }
    size_t mask() const { return _slots.size() - 1; }
    void put(const Slot& slot) {
        size_t i = slot.hash & mask();
        while (_tags[i] != kFree) i = (i + 1) & mask();
        _tags[i] = tagOf(slot.hash);
        _slots[i] = slot;
    }
    void grow() {
        std::vector<Slot> before(std::max<size_t>(16, _slots.size() * 2));
        before.swap(_slots);
        _tags.assign(_slots.size(), kFree);
        for (const Slot& slot : before)
            if (slot.number != kNone) put(slot);
    }

    std::vector<uint8_t> _tags; // of the slots
    std::vector<Slot> _slots;
    size_t _count = 0;
};

} // namespace rolvane
