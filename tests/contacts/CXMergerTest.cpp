#include "contacts/records/CXMerger.h"
#include "contacts/records/Constants.h"

#include <gtest/gtest.h>
#include <rapidcheck/gtest.h>

namespace rolvane {
namespace {

CXMutableMultiValue multi(std::initializer_list<std::pair<const char*, const char*>> entries) {
    CXMutableMultiValue m;
    for (const auto& [label, value] : entries) m.addValue(value, label);
    return m;
}

TEST(CXMerger, SingleValuesOfTheImportedCardWin) {
    Dictionary card{{"First", "Ann"}, {"Note", "old"}}, imported{{"First", "Anne"}, {"Last", "Lee"}};
    EXPECT_EQ(CXMerger::merged(card, imported), (Dictionary{{"First", "Anne"}, {"Last", "Lee"}, {"Note", "old"}}));
    EXPECT_EQ(card["First"].string(), "Ann") << "the card given is left alone";
}

TEST(CXMerger, MultiValuesAreUnitedByLabelAndValue) {
    auto own = multi({{"Home", "1"}, {"Work", "2"}});
    auto other = multi({{"Work", "2"}, {"Home", "2"}, {"Home", "1"}, {"Home", "3"}});
    auto merged =
        CXMultiValue::fromValue(CXMerger::merged({{"Phone", own.toValue()}}, {{"Phone", other.toValue()}})["Phone"]);
    ASSERT_TRUE(merged);
    EXPECT_TRUE(merged->sameContents(multi({{"Home", "1"}, {"Work", "2"}, {"Home", "2"}, {"Home", "3"}})));
    EXPECT_EQ(merged->identifierAtIndex(0), own.identifierAtIndex(0)) << "choices that name the entry still do";
    EXPECT_EQ(merged->identifierAtIndex(2), other.identifierAtIndex(1));
}

TEST(CXMerger, EqualIdentifiersOfDifferentEntriesDoNotMeet) {
    CXMutableMultiValue own, other;
    own.addValue("1", "Home", "same");
    other.addValue("2", "Home", "same");
    auto merged =
        CXMultiValue::fromValue(CXMerger::merged({{"Phone", own.toValue()}}, {{"Phone", other.toValue()}})["Phone"]);
    ASSERT_EQ(merged->count(), 2u);
    EXPECT_EQ(merged->identifierAtIndex(0), "same");
    EXPECT_NE(merged->identifierAtIndex(1), "same");
}

TEST(CXMerger, ListsOfStringsAreUnited) {
    Dictionary merged = CXMerger::merged({{"Categories", Array{"a", "b"}}}, {{"Categories", Array{"b", "c"}}});
    EXPECT_EQ(merged["Categories"], Value(Array{"a", "b", "c"}));
}

TEST(CXMerger, TheResultSharesNoContainerWithEitherCard) {
    Dictionary card{{"Address", multi({{"Home", "x"}}).toValue()}},
        imported{{"Phone", multi({{"Home", "1"}}).toValue()}};
    Dictionary merged = CXMerger::merged(card, imported);
    for (const auto& [key, value] : merged) {
        EXPECT_FALSE(card[key].dictionaryIf() && value.dictionaryIf()->isSame(*card[key].dictionaryIf())) << key;
        EXPECT_FALSE(imported[key].dictionaryIf() && value.dictionaryIf()->isSame(*imported[key].dictionaryIf()))
            << key;
    }
}

// A dictionary of a few properties with a few values, so that cards overlap.
Dictionary anyCard() {
    Dictionary d;
    for (const char* key : {"First", "Last"})
        if (*rc::gen::arbitrary<bool>()) d.set(key, *rc::gen::element<std::string>("a", "b"));
    for (const char* key : {"Phone", "Email"}) {
        int n = *rc::gen::inRange(0, 5);
        CXMutableMultiValue m;
        for (int i = 0; i < n; i++)
            m.addValue(*rc::gen::element<std::string>("1", "2", "3"), *rc::gen::element<std::string>("Home", "Work"));
        if (n) d.set(key, m.toValue());
    }
    return d;
}

size_t occurrences(const Value& v, const CXMultiValue::Entry& e) {
    auto m = CXMultiValue::fromValue(v);
    size_t n = 0;
    if (m)
        for (const auto& other : m->entries()) n += other.label == e.label && other.value == e.value;
    return n;
}

RC_GTEST_PROP(CXMergerProperty, NoValueIsEverLostOrMultiplied, ()) {
    Dictionary a = anyCard(), b = anyCard(), merged = CXMerger::merged(a, b);
    for (const char* key : {"First", "Last"}) RC_ASSERT(merged[key] == (b[key] ? b[key] : a[key]));
    for (const char* key : {"Phone", "Email"}) {
        for (const Value& side : {a[key], b[key], merged[key]}) {
            auto m = CXMultiValue::fromValue(side);
            if (!m) continue;
            for (const auto& e : m->entries())
                RC_ASSERT(occurrences(merged[key], e) == std::max(occurrences(a[key], e), occurrences(b[key], e)));
        }
    }
}

RC_GTEST_PROP(CXMergerProperty, MergingTheSameCardAgainChangesNothing, ()) {
    Dictionary a = anyCard(), b = anyCard(), merged = CXMerger::merged(a, b);
    RC_ASSERT(CXMerger::merged(merged, b) == merged);
    RC_ASSERT(CXMerger::merged(merged, merged) == merged);
}

} // namespace
} // namespace rolvane
