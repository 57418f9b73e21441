#include "foundation/BinaryValue.h"
#include "foundation/KeyedArchive.h"

#include <gtest/gtest.h>

namespace rolvane {
namespace {

// The form as it is documented, from a tree that holds all objects at once.
Bytes asOneTree(const std::vector<KeyedArchive::Object>& objects) {
    Array entries;
    for (const auto& o : objects) entries.append(Dictionary{{"class", o.className}, {"keys", o.keys}});
    Bytes bytes{'R', 'K', 'A', '1'};
    BinaryValue::encodeTo(Dictionary{{"objects", entries}}, bytes);
    return bytes;
}

TEST(KeyedArchiveInPieces, GivesTheBytesOfTheWholeTree) {
    for (const size_t count : {0u, 1u, 127u, 128u, 300u}) {
        std::vector<KeyedArchive::Object> objects;
        for (size_t i = 0; i < count; ++i) objects.push_back({"Thing", Dictionary{{"number", i}, {"name", "x"}}});
        const Bytes whole = asOneTree(objects);
        EXPECT_EQ(KeyedArchive::archive(objects), whole) << count;
        EXPECT_EQ(KeyedArchive::archive(count, [&](size_t i) { return objects[i]; }), whole) << count;
        EXPECT_EQ(KeyedArchive::unarchive(whole).size(), count);
    }
}

} // namespace
} // namespace rolvane
