#include "contacts/records/CXMultiValue.h"
#include "contacts/records/Constants.h"

#include <gtest/gtest.h>
#include <rapidcheck/gtest.h>

namespace rolvane {
namespace {

CXMutableMultiValue phones() {
    CXMutableMultiValue m;
    m.addValue("1", kCXHomeLabel);
    m.addValue("2", kCXWorkLabel);
    m.addValue("3", kCXHomeLabel);
    return m;
}

TEST(MultiValue, ReadsByIndexAndByIdentifier) {
    CXMutableMultiValue m = phones();
    ASSERT_EQ(m.count(), 3u);
    EXPECT_EQ(m.valueAtIndex(1).string(), "2");
    EXPECT_EQ(m.labelAtIndex(2), kCXHomeLabel);
    std::string second = m.identifierAtIndex(1);
    EXPECT_EQ(m.valueForIdentifier(second).string(), "2");
    EXPECT_EQ(m.labelForIdentifier(second), kCXWorkLabel);
    EXPECT_EQ(m._allValues(), (Array{"1", "2", "3"}));
    EXPECT_EQ(m.identifiers().size(), 3u);
}

TEST(MultiValue, AnIndexBeyondTheEndIsAnException) {
    CXMutableMultiValue m = phones();
    EXPECT_THROW(m.valueAtIndex(3), CXException);
    EXPECT_THROW(m.labelAtIndex(3), CXException);
    EXPECT_THROW(m.identifierAtIndex(3), CXException);
    EXPECT_THROW(m.removeAtIndex(3), CXException);
    EXPECT_THROW(m.insertValue("x", "", 4), CXException);
}

TEST(MultiValue, AnUnknownIdentifierGivesNothing) {
    CXMutableMultiValue m = phones();
    EXPECT_TRUE(m.valueForIdentifier("nobody").isAbsent());
    EXPECT_EQ(m.labelForIdentifier("nobody"), std::nullopt);
    EXPECT_FALSE(m.removeIdentifier("nobody"));
    EXPECT_EQ(m.count(), 3u);
}

TEST(MultiValue, IdentifiersStayWithTheirEntriesThroughEdits) {
    CXMutableMultiValue m = phones();
    std::string third = m.identifierAtIndex(2);
    m.removeAtIndex(0);
    m.insertValue("0", kCXOtherLabel, 0);
    ASSERT_TRUE(m.replaceValueForIdentifier(third, "33"));
    EXPECT_EQ(m.indexForIdentifier(third), 2u);
    EXPECT_EQ(m.valueAtIndex(2).string(), "33");
    EXPECT_EQ(m.labelAtIndex(2), kCXHomeLabel);
}

TEST(MultiValue, AnAbsentValueCannotBeAnEntry) {
    CXMutableMultiValue m = phones();
    EXPECT_THROW(m.addValue(Value(), "x"), CXException);
    EXPECT_THROW(m.replaceValueAtIndex(0, Value()), CXException);
    EXPECT_EQ(m, m);
    EXPECT_EQ(m.count(), 3u);
}

TEST(MultiValue, AnEmptyOneIsAValue) {
    auto read = CXMultiValue::fromValue(CXMultiValue().toValue());
    ASSERT_TRUE(read);
    EXPECT_EQ(read->count(), 0u);
}

TEST(MultiValue, TheValueFormHasThreeArraysOfOneLength) {
    Dictionary form = phones().toValue().dictionary();
    EXPECT_EQ(form["values"], Value(Array{"1", "2", "3"}));
    EXPECT_EQ(form["labels"], Value(Array{kCXHomeLabel, kCXWorkLabel, kCXHomeLabel}));
    EXPECT_EQ(form["identifiers"].array().count(), 3u);
}

TEST(MultiValue, AFormWithoutLabelsOrIdentifiersIsCompleted) {
    auto read = CXMultiValue::fromValue(Dictionary{{"values", Array{"a", "b", "c"}}, {"identifiers", Array{"i", "i"}}});
    ASSERT_TRUE(read);
    EXPECT_EQ(read->count(), 3u);
    EXPECT_EQ(read->labelAtIndex(0), "");
    EXPECT_EQ(read->identifierAtIndex(0), "i");
    EXPECT_NE(read->identifierAtIndex(1), "i");
    EXPECT_NE(read->identifierAtIndex(1), read->identifierAtIndex(2));
    EXPECT_FALSE(read->identifierAtIndex(2).empty());
}

TEST(MultiValue, OtherValuesAreNoMultiValues) {
    EXPECT_FALSE(CXMultiValue::fromValue("text"));
    EXPECT_FALSE(CXMultiValue::fromValue(Value()));
    EXPECT_FALSE(CXMultiValue::fromValue(Dictionary{{"values", "text"}}));
    EXPECT_FALSE(CXMultiValue::fromValue(Dictionary{{"Street", "x"}}));
}

TEST(MultiValue, GeneratedIdentifiersReplaceAllOfThem) {
    CXMutableMultiValue m = phones();
    CXMutableMultiValue other = m;
    other.generateIdentifiers();
    EXPECT_TRUE(m.sameContents(other));
    for (const std::string& identifier : m.identifiers()) EXPECT_FALSE(other.indexForIdentifier(identifier));
}

RC_GTEST_PROP(MultiValue, AnyOneSurvivesItsValueForm, (std::vector<std::pair<std::string, std::string>> entries)) {
    CXMutableMultiValue m;
    for (const auto& [label, value] : entries) m.addValue(value, label);
    RC_ASSERT(*CXMultiValue::fromValue(m.toValue()) == m);
}

} // namespace
} // namespace rolvane
