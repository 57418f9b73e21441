#include "foundation/Value.h"
#include "foundation/PropertyList.h"
#include "foundation/StrongString.h"

#include "Generators.h"

#include <gtest/gtest.h>
#include <rapidcheck/gtest.h>

#include <algorithm>
#include <cmath>
#include <limits>
#include <thread>
#include <unordered_set>

namespace rolvane {
namespace {

Array strings(int from, int to) {
    Array a;
    for (int i = from; i < to; ++i) a.append("s" + std::to_string(i));
    return a;
}

TEST(ArrayTest, ACopyOfTheHandleIsTheSameArray) {
    Array a{1, 2};
    Array b = a;
    b.append(3);
    EXPECT_EQ(a.count(), 3u);
    EXPECT_TRUE(a.isSame(b));
    Array c = a.mutableCopy();
    c.append(4);
    EXPECT_EQ(a.count(), 3u);
    EXPECT_FALSE(a.isSame(c));
}

TEST(ArrayTest, ThrowsARangeExceptionBeyondTheEnd) {
    Array a{1};
    const auto name = [](auto&& step) -> std::string {
        try {
            step();
        } catch (const CXException& e) {
            return e.name();
        }
        return "";
    };
    EXPECT_EQ(name([&] { a[1]; }), kCXRangeException);
    EXPECT_EQ(name([&] { a.insert(2, 1); }), kCXRangeException);
    EXPECT_EQ(name([&] { a.replace(1, 1); }), kCXRangeException);
    EXPECT_EQ(name([&] { a.removeAt(1); }), kCXRangeException);
    EXPECT_EQ(name([&] { a.insert(1, 2); }), "");
    EXPECT_EQ(a, (Array{1, 2}));
}

TEST(ArrayTest, AppendsItselfOnce) {
    Array a{"x", "y"};
    a.appendAll(a);
    EXPECT_EQ(a, (Array{"x", "y", "x", "y"}));
}

TEST(ArrayTest, RemovesEveryOccurrence) {
    Array a{"x", 1, "x", Array{1}, "y", Array{1}};
    a.removeAll("x");
    a.removeAll(Array{1});
    EXPECT_EQ(a, (Array{1, "y"}));
    a.removeAllOf(a);
    EXPECT_TRUE(a.empty());
}

TEST(ArrayTest, RemovesAnElementThatIsGivenByReferenceIntoTheArray) {
    Array a = strings(0, 50);
    a.removeAll(a[7]);
    EXPECT_EQ(a.count(), 49u);
    EXPECT_FALSE(a.containsString("s7"));
}

// The index of a large array must never disagree with its elements.
RC_GTEST_PROP(ArrayTest, ContainsAgreesWithALinearSearchAfterAnyChanges, ()) {
    Array a = strings(0, 30);
    for (int steps = *rc::gen::inRange(1, 60); steps > 0; --steps) {
        const Value v = "s" + std::to_string(*rc::gen::inRange(0, 40));
        const size_t at = a.empty() ? 0 : *rc::gen::inRange<size_t>(0, a.count());
        switch (*rc::gen::inRange(0, 8)) {
        case 0: a.append(v); break;
        case 1: a.insert(at, v); break;
        case 2: a.removeAll(v); break;
        case 3: a.removeAllOf(Array{v, "s1", 7}); break;
        case 4: a.append(7); break;
        case 5: a.appendAll(strings(3, 5)); break;
        case 6:
            if (!a.empty()) a.replace(at, v);
            break;
        default:
            if (!a.empty()) a.removeAt(at);
        }
        const Value asked = "s" + std::to_string(*rc::gen::inRange(0, 40));
        const bool there = std::find(a.begin(), a.end(), asked) != a.end();
        RC_ASSERT(a.contains(asked) == there);
        RC_ASSERT(a.containsString(asked.string()) == there);
        RC_ASSERT(a.indexOf(asked).has_value() == there);
    }
}

// Removals leave gaps until somebody looks at the order: nothing that does not look at it may notice them.
RC_GTEST_PROP(ArrayTest, RemovalsThatNobodyHasLookedAtYetKeepTheOrder, ()) {
    Array a = strings(0, 60);
    std::vector<Value> expected(a.begin(), a.end());
    for (int steps = *rc::gen::inRange(1, 80); steps > 0; --steps) {
        const Value v = "s" + std::to_string(*rc::gen::inRange(0, 70));
        switch (*rc::gen::inRange(0, 5)) {
        case 0:
        case 1:
            a.append(v);
            expected.push_back(v);
            break;
        default: a.removeAll(v); std::erase(expected, v);
        }
        const Value asked = "s" + std::to_string(*rc::gen::inRange(0, 70));
        const bool there = std::find(expected.begin(), expected.end(), asked) != expected.end();
        RC_ASSERT(a.count() == expected.size());
        RC_ASSERT(a.contains(asked) == there);
        RC_ASSERT(a.containsString(asked.string()) == there);
    }
    RC_ASSERT(a == Array(expected));
    RC_ASSERT(a.mutableCopy() == a);
}

TEST(ArrayTest, SeveralThreadsMayBeTheFirstToLookAfterRemovals) {
    const Array a = [] {
        Array made = strings(0, 2000);
        for (int i = 0; i < 2000; i += 2) made.removeAll("s" + std::to_string(i));
        return made;
    }();
    std::vector<std::thread> threads;
    std::atomic<size_t> found{0};
    for (int t = 0; t < 4; ++t)
        threads.emplace_back([&, t] {
            for (int i = 0; i < 200; ++i) found += a.containsString("s" + std::to_string(i)) ? 1 : 0;
            if (t % 2 == 0) found += static_cast<size_t>(std::distance(a.begin(), a.end()));
            found += a.count();
        });
    for (std::thread& t : threads) t.join();
    EXPECT_EQ(found, 4 * 100 + 2 * 1000 + 4 * 1000u);
}

TEST(ArrayTest, SeveralThreadsMayAskALargeArrayForTheFirstTime) {
    const Array a = strings(0, 2000);
    std::vector<std::thread> threads;
    std::atomic<int> found{0};
    for (int t = 0; t < 4; ++t)
        threads.emplace_back([&] {
            for (int i = 0; i < 200; ++i) found += a.containsString("s" + std::to_string(i)) ? 1 : 0;
        });
    for (std::thread& t : threads) t.join();
    EXPECT_EQ(found, 800);
}

TEST(DictionaryTest, EnumeratesInAscendingByteOrder) {
    const Dictionary d{{"b", 1}, {"\xc3\xa9", 2}, {"B", 3}, {"a", 4}, {"", 5}};
    EXPECT_EQ(d.allKeys(), (std::vector<std::string>{"", "B", "a", "b", "\xc3\xa9"}));
}

TEST(DictionaryTest, RefusesAbsentValues) {
    Dictionary d{{"k", 1}};
    EXPECT_THROW(d.set("k", Value()), CXException);
    EXPECT_THROW(d.setIfNew("n", Value()), CXException);
    EXPECT_EQ(d, (Dictionary{{"k", 1}}));
    EXPECT_TRUE(d["missing"].isAbsent());
}

TEST(DictionaryTest, SetsOnlyNewKeysWhenAskedTo) {
    Dictionary d{{"m", 1}};
    EXPECT_TRUE(d.setIfNew("a", 2));
    EXPECT_TRUE(d.setIfNew("z", 3));
    EXPECT_FALSE(d.setIfNew("m", 9));
    EXPECT_EQ(d, (Dictionary{{"a", 2}, {"m", 1}, {"z", 3}}));
}

TEST(DictionaryTest, EntriesOfTheOtherOneWin) {
    Dictionary d{{"a", 1}, {"b", 2}};
    d.addEntriesFrom(Dictionary{{"b", 3}, {"c", 4}});
    d.addEntriesFrom(d);
    EXPECT_EQ(d, (Dictionary{{"a", 1}, {"b", 3}, {"c", 4}}));
}

TEST(DictionaryTest, GivesTheContainerUnderAKeyAndMakesItWhenThereIsNone) {
    Dictionary d{{"s", "text"}};
    d.dictionaryFor("s").set("x", 1);
    d.arrayFor("l").append(2);
    d.arrayFor("l").append(3);
    EXPECT_EQ(d, (Dictionary{{"s", Dictionary{{"x", 1}}}, {"l", Array{2, 3}}}));
}

TEST(ValueTest, ReadersGiveTheFallbackForAnotherKind) {
    EXPECT_EQ(Value("x").integer(7), 7);
    EXPECT_EQ(Value("12").integer(), 12);
    EXPECT_EQ(Value("12x").integer(7), 7);
    EXPECT_EQ(Value(2.9).integer(), 2);
    EXPECT_EQ(Value(1e30).integer(7), 7);
    EXPECT_EQ(Value(std::nan("")).integer(7), 7);
    EXPECT_EQ(Value(true).integer(), 1);
    EXPECT_TRUE(Value(0.5).boolean());
    EXPECT_FALSE(Value("true").boolean());
    EXPECT_EQ(Value(3).real(), 3.0);
    EXPECT_EQ(Value(3).string(), "");
    EXPECT_EQ(Value(3).optionalString(), std::nullopt);
    EXPECT_EQ(Value(3).date(), std::nullopt);
    EXPECT_TRUE(Value(3).data().empty());
    EXPECT_TRUE(Value().array().empty());
    EXPECT_TRUE(Value().dictionary().empty());
}

TEST(ValueTest, AContainerReadFromAValueIsTheOneInside) {
    Value v = Dictionary{{"a", 1}};
    v.dictionary().set("b", 2);
    EXPECT_EQ(v.dictionary().count(), 2u);
}

TEST(ValueTest, ADeepCopySharesNoContainer) {
    const Value v = Dictionary{{"list", Array{Dictionary{{"x", 1}}}}};
    const Value copy = v.deepMutableCopy();
    EXPECT_EQ(copy, v);
    copy.dictionary()["list"].array()[0].dictionary().set("x", 2);
    EXPECT_EQ(v, Value(Dictionary{{"list", Array{Dictionary{{"x", 1}}}}}));
}

// A copy that has not changed is known to be equal without a look at its elements; nothing may look unchanged that is.
RC_GTEST_PROP(ValueTest, CopiesAreEqualForAsLongAsTheirElementsAre, ()) {
    std::vector<Array> arrays{strings(0, *rc::gen::inRange(0, 40))};
    std::vector<Dictionary> dictionaries{Dictionary{{"a", 1}, {"b", "x"}}};
    const auto steps = *rc::gen::container<std::vector<int>>(rc::gen::inRange(0, 14));
    for (const int step : steps) {
        Array& array = arrays[*rc::gen::inRange<size_t>(0, arrays.size())];
        Dictionary& dictionary = dictionaries[*rc::gen::inRange<size_t>(0, dictionaries.size())];
        const size_t at = array.empty() ? 0 : *rc::gen::inRange<size_t>(0, array.count());
        const std::string text = "s" + std::to_string(*rc::gen::inRange(0, 4));
        switch (step) {
        case 0: array.append(text); break;
        case 1: array.insert(at, text); break;
        case 2:
            if (!array.empty()) array.replace(at, text);
            break;
        case 3:
            if (!array.empty()) array.removeAt(at);
            break;
        case 4: array.removeAll(text); break;
        case 5: array.removeAllOf(Array{text, "s9"}); break;
        case 6: array.append(Array{text}); break;
        case 7: dictionary.set(text, 1); break;
        case 8: dictionary.remove(text); break;
        case 9: dictionary.setIfNew(std::string(text), 2); break;
        case 10: dictionary.arrayFor("list").append(text); break;
        case 11: dictionary.addEntriesFrom(dictionaries.front()); break;
        case 12: arrays.push_back(Value(array).deepMutableCopy().array()); break;
        default: dictionaries.push_back(Value(dictionary).deepMutableCopy().dictionary()); break;
        }
        const auto bytesOf = [](const Value& v) { return BinaryValue::encode(v); };
        for (const Array& a : arrays)
            for (const Array& b : arrays) RC_ASSERT((a == b) == (bytesOf(a) == bytesOf(b)));
        for (const Dictionary& a : dictionaries)
            for (const Dictionary& b : dictionaries) RC_ASSERT((a == b) == (bytesOf(a) == bytesOf(b)));
    }
}

// Dictionaries of dictionaries that were found equal are known to be so until one of all these changes.
RC_GTEST_PROP(ValueTest, DictionariesOfDictionariesAreEqualForAsLongAsTheirElementsAre, ()) {
    Dictionary first;
    for (int i = 0; i < 12; ++i) first.set("p" + std::to_string(i), Dictionary{{"Email", std::to_string(i % 3)}});
    std::vector<Dictionary> all{first, Value(first).deepMutableCopy().dictionary()};
    std::vector<Dictionary> held{all[0]["p1"].dictionary(), all[1]["p2"].dictionary()}; // somebody has them in hand
    const auto steps = *rc::gen::container<std::vector<int>>(rc::gen::inRange(0, 8));
    for (const int step : steps) {
        Dictionary& chosen = all[*rc::gen::inRange<size_t>(0, all.size())];
        const std::string key = "p" + std::to_string(*rc::gen::inRange(0, 12));
        const std::string text = std::to_string(*rc::gen::inRange(0, 3));
        switch (step) {
        case 0: chosen.dictionaryFor(key).set("Email", text); break;
        case 1: held[*rc::gen::inRange<size_t>(0, held.size())].set("Email", text); break;
        case 2: chosen.remove(key); break;
        case 3: chosen.set(key, Dictionary{{"Email", text}}); break;
        case 4: chosen.dictionaryFor(key).remove("Email"); break;
        case 5: chosen.dictionaryFor(key).arrayFor("list").append(text); break;
        case 6: chosen.set(key, all.front()["p3"].isDictionary() ? all.front()["p3"] : Value(text)); break;
        default: all.push_back(Value(chosen).deepMutableCopy().dictionary()); break;
        }
        const auto bytesOf = [](const Value& v) { return BinaryValue::encode(v); };
        for (const Dictionary& a : all)
            for (const Dictionary& b : all) RC_ASSERT((a == b) == (bytesOf(a) == bytesOf(b)));
    }
}

TEST(ValueTest, IntegersAndRealsAreEqualWhenTheirNumbersAreExactly) {
    EXPECT_EQ(Value(2), Value(2.0));
    EXPECT_NE(Value(2), Value(2.5));
    EXPECT_NE(Value((int64_t{1} << 53) + 1), Value(9007199254740992.0));
    EXPECT_NE(Value(std::numeric_limits<int64_t>::max()), Value(9223372036854775808.0));
    EXPECT_EQ(Value(9007199254740992.0), Value(int64_t{1} << 53));
    EXPECT_NE(Value(1), Value(std::nan("")));
}

TEST(ValueTest, ABooleanEqualsOnlyABoolean) {
    EXPECT_NE(Value(true), Value(1));
    EXPECT_NE(Value(false), Value());
    EXPECT_EQ(Value(true), Value(true));
    EXPECT_EQ(Value(), Value());
    EXPECT_NE(Value("1"), Value(1));
    EXPECT_NE(Value(Date(1)), Value(1));
}

TEST(ValueTest, DescribesStringsAsTheyAreAtTheTopAndQuotedInside) {
    EXPECT_EQ(Value("a b").description(), "a b");
    EXPECT_EQ(Value().description(), "(null)");
    EXPECT_EQ(Value(Bytes(3)).description(), "<3 bytes>");
    EXPECT_EQ(Value(Date(0)).description(), "1970-01-01T00:00:00Z");
    EXPECT_EQ(Value(Dictionary{{"k", Array{"x", 1}}}).description(), "{\n"
                                                                     "    \"k\" = (\n"
                                                                     "        \"x\",\n"
                                                                     "        1,\n"
                                                                     "    );\n"
                                                                     "}");
}

TEST(ValueTest, DescribesAContainerThatHoldsItself) {
    Array a;
    a.append(a);
    EXPECT_NE(a[0].description().find("..."), std::string::npos);
    a.removeAt(0); // or it would never be freed
}

TEST(ValueTest, TakesTheTextOfAStrongString) {
    EXPECT_EQ(Value(UserName("ada")), Value("ada"));
}

TEST(ValueTest, MakesNoBooleanOfAPointer) {
    EXPECT_FALSE((std::is_constructible_v<Value, const Bytes*>));
    EXPECT_FALSE((std::is_constructible_v<Value, Dictionary*>));
    EXPECT_TRUE((std::is_constructible_v<Value, char*>));
}

TEST(ValueTest, TheUnionKeepsTheOrderOfBoth) {
    const Array a{"b", "a", "b"};
    EXPECT_EQ(cxArrayCombinedWithArray(a, Array{"c", "a", "c"}), (Array{"b", "a", "b", "c"}));
    EXPECT_EQ(a.count(), 3u);
}

// The literal definition, element by element.
RC_GTEST_PROP(ValueTest, DifferencesAreThoseOfTheLiteralDefinition, ()) {
    const auto list = rc::gen::container<std::vector<int>>(rc::gen::inRange(0, 60));
    const std::vector<int> before = *list, after = *list;
    const auto array = [](const std::vector<int>& v) {
        Array a;
        for (const int i : v) a.append(i % 5 == 0 ? Value(i) : Value(std::to_string(i)));
        return a;
    };
    const auto onlyIn = [](const std::vector<int>& in, const std::vector<int>& notIn) {
        std::vector<int> rest;
        for (const int i : in)
            if (std::find(notIn.begin(), notIn.end(), i) == notIn.end()) rest.push_back(i);
        return rest;
    };
    const Dictionary d = cxDifferencesBetweenArray(array(before), array(after));
    RC_ASSERT(d["additions"].array() == array(onlyIn(after, before)));
    RC_ASSERT(d["deletions"].array() == array(onlyIn(before, after)));
    RC_ASSERT(d.count() == 2u);
}

TEST(StrongStringTest, SharesItsTextWithTheValueMadeOfIt) {
    const UserName name("somebody with a long name");
    const Value value(name);
    EXPECT_EQ(&value.string(), &name.str());
    EXPECT_EQ(&UserName(*value.textIf()).str(), &name.str());
}

TEST(StrongStringTest, TwoKindsCannotBeSwapped) {
    EXPECT_FALSE((std::is_convertible_v<UserName, RemoteLocation>));
    EXPECT_FALSE((std::is_constructible_v<UserName, RemoteLocation>));
    EXPECT_FALSE((std::is_convertible_v<std::string, UserName>));
    EXPECT_FALSE((std::is_assignable_v<UserName&, UniqueId>));
    EXPECT_FALSE((std::equality_comparable_with<UserName, UniqueId>));
}

TEST(StrongStringTest, OrdersAndHashesAsItsText) {
    EXPECT_LT(UniqueId("a"), UniqueId("b"));
    EXPECT_EQ((std::unordered_set<UniqueId>{UniqueId("a"), UniqueId("a")}).size(), 1u);
    EXPECT_TRUE(UniqueId("1:CXGroup").endsWith("CXGroup"));
    EXPECT_FALSE(UniqueId("p").endsWith("CXGroup"));
    EXPECT_EQ(kSelf.str(), "<self>");
}

} // namespace
} // namespace rolvane
