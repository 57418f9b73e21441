#include "foundation/KeyedArchive.h"

#include "foundation/BinaryValue.h"

#include "Generators.h"

#include <gtest/gtest.h>
#include <rapidcheck/gtest.h>

namespace rolvane {
namespace {

Bytes archiveOf(const Value& root) {
    Bytes bytes{'R', 'K', 'A', '1'};
    BinaryValue::encodeTo(root, bytes);
    return bytes;
}

std::string refusal(const Bytes& bytes) {
    try {
        KeyedArchive::unarchive(bytes);
    } catch (const CXException& e) {
        EXPECT_EQ(e.name(), kCXArchiveException);
        return e.reason();
    }
    return "";
}

TEST(DictionaryCoderTest, GivesBackWhatWasEncoded) {
    DictionaryCoder coder;
    EXPECT_TRUE(coder.allowsKeyedCoding());
    coder.encodeInteger(-5, "n");
    coder.encodeObject("text", "s");
    EXPECT_EQ(coder.decodeInteger("n"), -5);
    EXPECT_EQ(coder.decodeObject("s"), Value("text"));
    EXPECT_EQ(coder.entries(), (Dictionary{{"n", -5}, {"s", "text"}}));
}

TEST(DictionaryCoderTest, AnAbsentObjectWritesNothingAndMissingKeysReadAsZeroOrAbsent) {
    DictionaryCoder coder;
    coder.encodeObject(Value(), "s");
    EXPECT_TRUE(coder.entries().empty());
    EXPECT_EQ(coder.decodeInteger("n"), 0);
    EXPECT_TRUE(coder.decodeObject("s").isAbsent());
}

TEST(KeyedArchiveTest, HasExactlyTheDocumentedForm) {
    const Dictionary keys{{"n", 1}};
    EXPECT_EQ(KeyedArchive::archive({{"C", keys}}),
              archiveOf(Dictionary{{"objects", Array{Dictionary{{"class", "C"}, {"keys", keys}}}}}));
}

TEST(KeyedArchiveTest, AnEmptyArchiveHasNoObjects) {
    EXPECT_TRUE(KeyedArchive::unarchive(KeyedArchive::archive({})).empty());
}

RC_GTEST_PROP(KeyedArchiveTest, ObjectsComeBackInOrder, ()) {
    std::vector<KeyedArchive::Object> objects;
    for (int n = *rc::gen::inRange(0, 5); n > 0; --n)
        objects.push_back({*test::anyText(), Dictionary{{"object", Array{*test::anyValue()}}}});
    const auto back = KeyedArchive::unarchive(KeyedArchive::archive(objects));
    RC_ASSERT(back.size() == objects.size());
    for (size_t i = 0; i < back.size(); ++i) {
        RC_ASSERT(back[i].className == objects[i].className);
        RC_ASSERT(back[i].keys == objects[i].keys);
    }
}

TEST(KeyedArchiveTest, RefusesWhatIsNoArchive) {
    EXPECT_NE(refusal({}), "");
    EXPECT_NE(refusal({'R', 'K', 'A', '1'}), "");
    EXPECT_NE(refusal({'R', 'K', 'A', '2', 0x08, 0x00}), "");
    EXPECT_NE(refusal(archiveOf(Array{})), "");
    EXPECT_NE(refusal(archiveOf(Dictionary{})), "");
    EXPECT_NE(refusal(archiveOf(Dictionary{{"objects", 1}})), "");
    EXPECT_NE(refusal(archiveOf(Dictionary{{"objects", Array{1}}})), "");
    EXPECT_NE(refusal(archiveOf(Dictionary{{"objects", Array{Dictionary{{"class", "C"}}}}})), "");
    EXPECT_NE(refusal(archiveOf(Dictionary{{"objects", Array{Dictionary{{"keys", Dictionary{}}}}}})), "");
    EXPECT_EQ(refusal(archiveOf(Dictionary{{"objects", Array{}}})), "");
}

TEST(KeyedArchiveTest, RefusesEveryTruncation) {
    const Bytes whole = KeyedArchive::archive({{"CXDChangeRecord", Dictionary{{"payload", Dictionary{{"a", 1}}}}}});
    for (size_t n = 0; n < whole.size(); ++n)
        EXPECT_NE(refusal(Bytes(whole.begin(), whole.begin() + static_cast<std::ptrdiff_t>(n))), "") << n;
}

} // namespace
} // namespace rolvane
