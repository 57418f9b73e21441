#include "foundation/NumberTable.h"

#include <map>

#include <gtest/gtest.h>
#include <rapidcheck/gtest.h>

namespace rolvane {
namespace {

// Hashes that differ in the low bits, in the high ones, or not at all.
RC_GTEST_PROP(NumberTableTest, FindsWhatAMapFindsWhateverTheHashesShare, ()) {
    const auto key = [] { return *rc::gen::inRange<uint32_t>(0, 200); };
    const auto hashOf = [](uint32_t k) { return (k & 1 ? k << 25 : k % 7) | (k & 2 ? 0x100 : 0); };
    NumberTable table;
    std::map<uint32_t, uint32_t> expected;
    std::vector<uint32_t> keys; // by number
    for (int steps = *rc::gen::inRange(0, 300); steps > 0; --steps) {
        const uint32_t asked = key();
        const auto found = table.find(hashOf(asked), [&](uint32_t number) { return keys[number] == asked; });
        const auto known = expected.find(asked);
        RC_ASSERT(found == (known == expected.end() ? NumberTable::kNone : known->second));
        if (known != expected.end()) continue;
        const auto number = static_cast<uint32_t>(keys.size());
        table.add(hashOf(asked), number);
        expected[asked] = number;
        keys.push_back(asked);
    }
}

} // namespace
} // namespace rolvane
