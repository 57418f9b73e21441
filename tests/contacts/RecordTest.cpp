#include "TestDatabase.h"

#include "foundation/PropertyList.h"
#include "support/CapturingLog.h"

#include <sys/stat.h>

namespace rolvane::test {
namespace {

TEST(Record, PropertiesSurviveASaveAndAReopening) {
    TestDatabase d;
    CXPersonRef ada = d.addPerson("Ada");
    UniqueId uid = ada->uniqueId();
    CXMutableMultiValue phones;
    phones.addValue("+44 1", kCXHomeLabel);
    ada->setValue(phones, kCXPhoneProperty);
    ada->setValue(Bytes{1, 2, 3}, kCXPhotoProperty);
    Dictionary before = ada->dictionaryRepresentation();
    d->save();
    ada.reset();
    d.reopen();
    auto again = std::dynamic_pointer_cast<CXPerson>(d->recordForUniqueId(uid));
    ASSERT_TRUE(again);
    EXPECT_EQ(again->dictionaryRepresentation(), before);
    EXPECT_EQ(again->multiValueForProperty(kCXPhoneProperty), phones);
    EXPECT_EQ(again->cxUsedProperties(), (std::vector<std::string>{"First", "Phone", "Photo"}));
}

TEST(Record, TheEncodedFormIsThatOfTheDictionaryStoredOrNot) {
    TestDatabase d;
    CXPersonRef ada = d.addPerson("Ada");
    EXPECT_EQ(*ada->encodedRepresentation(), BinaryValue::encode(ada->dictionaryRepresentation()));
    d->save();
    EXPECT_EQ(*ada->encodedRepresentation(), BinaryValue::encode(ada->dictionaryRepresentation()));
    EXPECT_EQ(ada->encodedRepresentation(), ada->encodedRepresentation()) << "shared, not copied";
}

TEST(Record, AnEmptyMultiValueIsPresentAndAnAbsentOneIsNot) {
    TestDatabase d;
    CXPersonRef ada = d.addPerson("Ada");
    ada->setValue(CXMultiValue(), kCXEmailProperty);
    d->save();
    d.reopen();
    CXRecordRef again = d->recordForUniqueId(ada->uniqueId());
    ASSERT_TRUE(again->multiValueForProperty(kCXEmailProperty));
    EXPECT_EQ(again->multiValueForProperty(kCXEmailProperty)->count(), 0u);
    EXPECT_FALSE(again->multiValueForProperty(kCXPhoneProperty));
    again->removeValueForProperty(kCXEmailProperty);
    EXPECT_FALSE(again->multiValueForProperty(kCXEmailProperty));
}

TEST(Record, WhatValueForPropertyGivesIsTheCallersOwn) {
    TestDatabase d;
    CXPersonRef ada = d.addPerson("Ada");
    ada->setValue(Array{"a"}, kCXCategoriesProperty);
    d->save();
    ada->valueForProperty(kCXCategoriesProperty).array().append("b");
    ada->dictionaryRepresentation()[kCXCategoriesProperty].array().append("c");
    EXPECT_EQ(ada->valueForProperty(kCXCategoriesProperty), Value(Array{"a"}));
}

TEST(Record, TextThatAStoreCannotCarryIsKeptWithoutWhatItCannotCarry) {
    TestDatabase d;
    CXPersonRef ada = d.addPerson("Ada");
    ada->setValue("a\x01"
                  "b\tc\n\xff",
                  kCXNoteProperty);
    CXMutableMultiValue phones;
    phones.addValue("1\x02"
                    "2",
                    "la\x03"
                    "bel");
    ada->setValue(phones, kCXPhoneProperty);
    EXPECT_EQ(ada->valueForProperty(kCXNoteProperty), Value("ab\tc\n\uFFFD"));
    EXPECT_EQ(ada->multiValueForProperty(kCXPhoneProperty)->valueAtIndex(0), Value("12"));
    EXPECT_EQ(ada->multiValueForProperty(kCXPhoneProperty)->labelAtIndex(0), "label");
    ada->resetWithDictionary({{kCXFirstNameProperty, "A\x04"
                                                     "da"}},
                             true, false);
    EXPECT_EQ(ada->valueForProperty(kCXFirstNameProperty), Value("Ada"));
    EXPECT_NO_THROW(PropertyList::toXML(ada->dictionaryRepresentation()));
}

TEST(Record, TwoLookupsGiveOneHandle) {
    TestDatabase d;
    CXPersonRef ada = d.addPerson("Ada");
    EXPECT_EQ(d->recordForUniqueId(ada->uniqueId()), ada);
    d->save();
    EXPECT_EQ(d->recordForUniqueId(ada->uniqueId()), ada);
}

TEST(Record, IdentifierAndDatesCanBeReadButNotSet) {
    TestDatabase d;
    CXPersonRef ada = d.addPerson("Ada");
    d->save();
    d.clock.advance(10);
    ada->setValue("Ada B", kCXFirstNameProperty);
    d->save();
    EXPECT_EQ(ada->valueForProperty(kCXUIDProperty), Value(ada->uniqueId()));
    EXPECT_EQ(ada->valueForProperty(kCXCreationDateProperty).date(), Date(1700000000));
    EXPECT_EQ(ada->valueForProperty(kCXModificationDateProperty).date(), Date(1700000010));
    EXPECT_FALSE(ada->setValue("x", kCXUIDProperty));
    EXPECT_FALSE(ada->setValue(Date(1), kCXModificationDateProperty));
    EXPECT_FALSE(d->hasUnsavedChanges());
}

TEST(Record, ASaveThatChangesNothingKeepsTheModificationDateAndWritesNoJournal) {
    TestDatabase d;
    CXPersonRef ada = d.addPerson("Ada");
    d->save();
    int64_t end = d->journalPosition();
    d.clock.advance(10);
    ada->setValue("Ada", kCXFirstNameProperty);
    d->save();
    EXPECT_EQ(d->journalPosition(), end);
    EXPECT_EQ(ada->valueForProperty(kCXModificationDateProperty).date(), Date(1700000000));
}

TEST(Record, AMultiValueIsTakenAsItIsExactlyWhenNothingIsWrongWithIt) {
    const auto multi = [](Array identifiers, Array labels, Array values) {
        return Value(Dictionary{{"identifiers", identifiers}, {"labels", labels}, {"values", values}});
    };
    const auto taken = [](const char* property, const Value& value) {
        return cxSanitizedProperties("CXPerson", Dictionary{{property, value}}, true, false)[property];
    };
    const Value clean = multi({"1", "2"}, {"home", ""}, {"+1", "+2"});
    EXPECT_EQ(taken("Phone", clean), clean);
    const Value kept = taken("Phone", clean);
    Array(clean.dictionary()["values"].array()).append("+3");
    EXPECT_EQ(kept, multi({"1", "2"}, {"home", ""}, {"+1", "+2"})) << "shares nothing with what it was made of";

    EXPECT_EQ(taken("Phone", multi({"1", "2"}, {"a", "b"}, {"+1", 2})), multi({"1"}, {"a"}, {"+1"})) << "wrong type";
    EXPECT_EQ(taken("Phone", multi({"1"}, {"a"}, {std::string("+\x01") + "1"})), multi({"1"}, {"a"}, {"+1"}));
    EXPECT_EQ(taken("Phone", multi({"1"}, {std::string("a\x01")}, {"+1"})), multi({"1"}, {"a"}, {"+1"}));
    EXPECT_EQ(taken("Phone", multi({"1"}, {Value(3)}, {"+1"})), multi({"1"}, {""}, {"+1"})) << "no label";
    EXPECT_EQ(taken("Phone", multi({"1"}, {}, {"+1"})), multi({"1"}, {""}, {"+1"}));
    const Value twice = taken("Phone", multi({"1", "1"}, {"a", "b"}, {"+1", "+2"})).dictionary()["identifiers"];
    EXPECT_EQ(twice.array().count(), 2u);
    EXPECT_NE(twice.array()[0], twice.array()[1]);
    Dictionary more = multi({"1"}, {"a"}, {"+1"}).dictionary();
    more.set("else", 1);
    EXPECT_EQ(taken("Phone", more), multi({"1"}, {"a"}, {"+1"})) << "and nothing besides";
}

TEST(Record, ResettingReplacesEverythingAndDropsWhatItDoesNotKnow) {
    TestDatabase d;
    CXPersonRef ada = d.addPerson("Ada");
    d->save();
    Dictionary fresh{{"Last", "Byron"},
                     {"Bogus", "x"},
                     {"Phone", "not a multi-value"},
                     {"Note", Array{"no string"}},
                     {"UID", "stolen"},
                     {"Email", Dictionary{{"values", Array{"a@b", 7}},
                                          {"labels", Array{"Home", "Work"}},
                                          {"identifiers", Array{"one", "two"}}}}};
    ada->resetWithDictionary(fresh, true, false);
    EXPECT_EQ(ada->cxUsedProperties(), (std::vector<std::string>{"Email", "Last"}));
    auto mails = ada->multiValueForProperty(kCXEmailProperty);
    ASSERT_EQ(mails->count(), 1u);
    EXPECT_EQ(mails->identifierAtIndex(0), "one");
    ada->resetWithDictionary(fresh, true, true);
    EXPECT_NE(ada->multiValueForProperty(kCXEmailProperty)->identifierAtIndex(0), "one");
    ada->resetWithDictionary(fresh, false, false);
    EXPECT_EQ(ada->valueForProperty("Bogus").string(), "x");
    EXPECT_NE(ada->valueForProperty(kCXUIDProperty).string(), "stolen");
}

TEST(Record, AResetWithTheSameDictionaryIsNoChange) {
    TestDatabase d;
    CXPersonRef ada = d.addPerson("Ada");
    d->save();
    int64_t end = d->journalPosition();
    ada->resetWithDictionary(ada->dictionaryRepresentation(), true, false);
    d->save();
    EXPECT_EQ(d->journalPosition(), end);
}

TEST(Record, ATransientPersonNeedsNoDatabase) {
    Dictionary values{{"First", "Ada"}, {"Bogus", "x"}};
    CXPersonRef ada = CXPerson::personFromDictionary(values, nullptr, true, false);
    EXPECT_EQ(ada->dictionaryRepresentation(), (Dictionary{{"First", "Ada"}}));
    EXPECT_FALSE(ada->isAttached());
    EXPECT_TRUE(ada->parentGroups().empty());
    EXPECT_EQ(ada->displayName(), "Ada");
}

TEST(Record, APersonFromADictionaryCanGoStraightIntoADatabase) {
    TestDatabase d;
    CXPersonRef ada = CXPerson::personFromDictionary({{"First", "Ada"}}, d.database.get(), true, false);
    d->save();
    EXPECT_EQ(d->countPeople(std::nullopt), 1u);
    EXPECT_TRUE(ada->isAttached());
}

TEST(Record, ARemovedRecordReadsAsEmptyAndTakesNoChanges) {
    TestDatabase d;
    CXPersonRef ada = d.addPerson("Ada");
    d->save();
    EXPECT_TRUE(d->removeRecord(ada));
    EXPECT_FALSE(d->removeRecord(ada));
    EXPECT_EQ(d->recordForUniqueId(ada->uniqueId()), nullptr);
    EXPECT_TRUE(ada->dictionaryRepresentation().empty());
    EXPECT_FALSE(ada->setValue("x", kCXFirstNameProperty));
    d->save();
    d.reopen();
    EXPECT_EQ(d->countPeople(std::nullopt), 0u);
}

TEST(Record, AHandleOutlivesItsDatabaseHarmlessly) {
    TestDatabase d;
    CXPersonRef ada = d.addPerson("Ada");
    d->save();
    d.database.reset();
    EXPECT_TRUE(ada->valueForProperty(kCXFirstNameProperty).isAbsent());
    EXPECT_FALSE(ada->setValue("x", kCXFirstNameProperty));
    EXPECT_EQ(ada->rolvane(), nullptr);
}

TEST(Record, AddingAnIdentifierThatIsHereReplacesThePropertiesAndKeepsTheMembers) {
    TestDatabase d;
    CXGroupRef friends = d.addGroup("Friends", "G:CXGroup");
    CXPersonRef ada = d.addPerson("Ada");
    friends->addMember(ada);
    d->save();
    CXGroupRef twin = CXGroup::initWithUniqueId(UniqueId("G:CXGroup"));
    twin->setValue("Pals", kCXGroupNameProperty);
    d->addRecord(twin);
    d->save();
    EXPECT_EQ(friends->name(), "Pals");
    EXPECT_EQ(names(twin->members()), (std::vector<std::string>{"Ada"}));
    EXPECT_EQ(d->allGroup()->subgroupUniqueIds().size(), 1u);
}

TEST(Record, APersonCannotTakeTheIdentifierOfAGroup) {
    TestDatabase d;
    CXGroupRef friends = d.addGroup("Friends", "G:CXGroup");
    EXPECT_THROW(d.addPerson("Ada", "G:CXGroup"), CXException);
    EXPECT_THROW(d.addGroup("All", "AllCXGroup"), CXException);
    EXPECT_EQ(d->allGroup()->name(), "All Contacts");
}

TEST(Record, DisplayNamesFallBackFromNameToMailToNothing) {
    EXPECT_EQ(cxDisplayName({{"First", "Ada"}, {"Last", "Byron"}}), "Ada Byron");
    EXPECT_EQ(cxDisplayName({{"First", "Ada"}, {"Organization", "Works"}, {"IsCompany", true}}), "Works");
    EXPECT_EQ(cxDisplayName({{"Organization", "Works"}}), "Works");
    EXPECT_EQ(cxDisplayName({{"Email", Dictionary{{"values", Array{"a@b"}}}}}), "a@b");
    EXPECT_EQ(cxDisplayName({}), "(no name)");
}

TEST(Record, FilesAreForTheOwnerAloneWhateverTheUmask) {
    mode_t former = ::umask(0);
    TestDatabase d;
    d.addPerson("Ada");
    d->save();
    for (std::string suffix : {"", "-wal", "-shm", "-changed"}) {
        struct stat status {};
        ASSERT_EQ(::stat((d.path + suffix).c_str(), &status), 0) << suffix;
        EXPECT_EQ(status.st_mode & 0777, 0600u) << suffix;
    }
    struct stat status {};
    ::stat((d.directory / "data").c_str(), &status);
    ::umask(former);
    EXPECT_EQ(status.st_mode & 0777, 0700u);
}

} // namespace
} // namespace rolvane::test
