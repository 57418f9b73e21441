#include "TestDatabase.h"

#include "foundation/PropertyList.h"

namespace rolvane::test {
namespace {

std::vector<CXRow> rows(CXRolvane& database, Date since, std::string_view table = kCXPersonTable) {
    std::vector<CXRow> all;
    database.forEachPersonModifiedSince(since, table, [&](const CXRow& row) { all.push_back(row); });
    return all;
}

TEST(Scan, DoesNotSeeTheMembersOfAGroupThatWasTakenOutOrMadeAnew) {
    TestDatabase d;
    CXPersonRef ada = d.addPerson("Ada");
    for (const char* uid : {"A:CXGroup", "B:CXGroup", "C:CXGroup"}) {
        CXGroupRef group = CXGroup::initWithUniqueId(UniqueId(uid));
        group->setValue("a group", kCXGroupNameProperty);
        d->addRecord(group);
        group->addMember(ada);
    }
    d->save();
    d->removeRecord(d->recordForUniqueId(UniqueId("A:CXGroup")));
    d->removeRecord(d->recordForUniqueId(UniqueId("B:CXGroup")));
    CXGroupRef anew = CXGroup::initWithUniqueId(UniqueId("B:CXGroup"));
    anew->setValue("another group", kCXGroupNameProperty);
    d->addRecord(anew);
    for (int round = 0; round < 2; round++, d->save()) {
        std::vector<UniqueId> parents;
        d->forEachPersonModifiedSince(Date::distantPast(), kCXPersonTable,
                                      [&](const CXRow& row) { parents = row.parentGroups; });
        EXPECT_EQ(parents, std::vector{UniqueId("C:CXGroup")});
    }
}

TEST(Scan, FindsWhatWasModifiedStrictlyAfterTheDate) {
    TestDatabase d;
    d.addPerson("Old");
    d->save();
    Date old = d.clock.now();
    d.clock.advance(1e-6);
    d.addPerson("New");
    d->save();
    ASSERT_EQ(rows(*d, old).size(), 1u);
    EXPECT_EQ(BinaryValue::decode(*rows(*d, old)[0].encoded), Value(Dictionary{{"First", "New"}}));
    EXPECT_EQ(rows(*d, Date::distantPast()).size(), 2u);
    EXPECT_TRUE(rows(*d, d.clock.now()).empty());
    auto found = d->recordsMatchingSearchElement(
        CXPerson::searchElementForProperty(kCXModificationDateProperty, "", "", old, kCXGreaterThan));
    ASSERT_EQ(found.size(), 1u);
    EXPECT_EQ(found[0]->valueForProperty(kCXFirstNameProperty).string(), "New");
}

TEST(Scan, GivesRowsWithTheirParentGroupsOverManyPages) {
    TestDatabase d;
    CXGroupRef even = d.addGroup("Even"), all = d.addGroup("All");
    for (int i = 0; i < 1203; i++) {
        CXPersonRef p = d.addPerson(std::to_string(i));
        if (i % 2 == 0) even->addMember(p);
        all->addMember(p);
    }
    d->save();
    auto found = rows(*d, Date::distantPast());
    ASSERT_EQ(found.size(), 1203u);
    std::set<UniqueId> seen;
    for (const CXRow& row : found) {
        auto person = std::dynamic_pointer_cast<CXPerson>(d->recordForUniqueId(row.uniqueId));
        EXPECT_EQ(row.parentGroups, person->parentGroupUniqueIds());
        EXPECT_EQ(*row.encoded, *person->encodedRepresentation());
        EXPECT_EQ(row.sharingUniqueId, person->sharingUniqueId());
        EXPECT_TRUE(row.location.empty());
        seen.insert(row.uniqueId);
    }
    EXPECT_EQ(seen.size(), 1203u);
    size_t members = 0;
    d->forEachMember(*even, [&](const CXRow&) { members++; });
    EXPECT_EQ(members, 602u);
}

TEST(Scan, GivesTheRowsOfEverybodyInMemberOrderSavedOrNot) {
    TestDatabase d;
    CXGroupRef odd = d.addGroup("Odd");
    for (int i = 0; i < 1001; i++) {
        CXPersonRef p = d.addPerson(std::to_string(i));
        if (i % 2 != 0) odd->addMember(p);
    }
    const auto compare = [&](const CXGroup& group) {
        std::vector<UniqueId> seen;
        d->forEachMember(group, [&](const CXRow& row) {
            auto person = std::dynamic_pointer_cast<CXPerson>(d->recordForUniqueId(row.uniqueId));
            EXPECT_EQ(row.parentGroups, person->parentGroupUniqueIds());
            EXPECT_EQ(*row.encoded, *person->encodedRepresentation());
            EXPECT_EQ(row.writer, d->programName());
            seen.push_back(row.uniqueId);
        });
        EXPECT_EQ(seen, group.memberUniqueIds());
    };
    for (const bool saved : {false, true}) {
        if (saved) d->save();
        compare(*odd);
        compare(*d->allGroup());
    }
    EXPECT_EQ(d->peopleOfTable(kCXPersonTable), d->allGroup()->memberUniqueIds());
    EXPECT_TRUE(d->peopleOfTable(kCXSubscribedPersonTable).empty());
}

TEST(Scan, MembersThatTheCallbackChangesOrRemovesAreGivenAsTheyAreThen) {
    TestDatabase d;
    CXGroupRef all = d.addGroup("All");
    std::vector<CXPersonRef> people;
    for (int i = 0; i < 4; i++) {
        people.push_back(d.addPerson(std::to_string(i)));
        all->addMember(people.back());
    }
    d->save();
    std::vector<std::string> names;
    d->forEachMember(*all, [&](const CXRow& row) {
        names.push_back(BinaryValue::decode(*row.encoded).dictionary()[kCXFirstNameProperty].string());
        if (names.size() != 1) return;
        people[1]->setValue("changed", kCXFirstNameProperty);
        d->removeRecord(people[2]);
    });
    EXPECT_EQ(names, (std::vector<std::string>{"0", "changed", "3"}));
}

TEST(Scan, KeepsSubscribedPeopleApart) {
    TestDatabase d;
    d.addPerson("Mine");
    CXPersonRef theirs = d.addSubscribedPerson("Theirs", "http://s/bob/Contacts");
    d->save();
    auto found = rows(*d, Date::distantPast(), kCXSubscribedPersonTable);
    ASSERT_EQ(found.size(), 1u);
    EXPECT_EQ(found[0].uniqueId, theirs->uniqueId());
    EXPECT_EQ(found[0].location.str(), "http://s/bob/Contacts");
    EXPECT_EQ(found[0].sharingUniqueId, theirs->sharingUniqueId());
    EXPECT_THROW(rows(*d, Date::distantPast(), kCXGroupTable), CXException);
}

TEST(Scan, ItsCallMayUseAndSaveTheDatabase) {
    TestDatabase d;
    for (int i = 0; i < 600; i++) d.addPerson("P");
    d->save();
    auto other = d.open("rolvane");
    int seen = 0;
    d->forEachPersonModifiedSince(Date::distantPast(), kCXPersonTable, [&](const CXRow& row) {
        if (seen++ % 200 != 0) return;
        TestDatabase::addPersonTo(*other, "Meanwhile");
        other->save();
        d->recordForUniqueId(row.uniqueId)->setValue("x", kCXNoteProperty);
        d->save();
    });
    EXPECT_GE(seen, 600);
    EXPECT_GE(d->countPeople(std::nullopt), 603u);
}

TEST(Scan, CountsUnsavedChangesAsModifiedNow) {
    TestDatabase d;
    CXPersonRef a = d.addPerson("A");
    d->save();
    Date then = d.clock.now();
    d.clock.advance(1);
    a->setValue("A2", kCXFirstNameProperty);
    d.addPerson("B");
    EXPECT_EQ(rows(*d, then).size(), 2u);
    d->rollback();
    EXPECT_TRUE(rows(*d, then).empty());
    EXPECT_EQ(a->valueForProperty(kCXFirstNameProperty).string(), "A");
}

TEST(Scan, GroupsAreFoundByDateButTheAllContactsGroupsNever) {
    TestDatabase d;
    d->addRecord(CXSubscription::create(RemoteLocation("http://s/bob/Contacts")));
    CXGroupRef friends = d.addGroup("Friends");
    CXPersonRef a = d.addPerson("A");
    d->save();
    Date then = d.clock.now();
    auto since = [&](Date date) {
        auto found = d->recordsMatchingSearchElement(
            CXGroup::searchElementForProperty(kCXModificationDateProperty, "", "", date, 4));
        auto subscribed = d->recordsMatchingSearchElement(
            CXSubscribedGroup::searchElementForProperty(kCXModificationDateProperty, "", "", date, 4));
        found.insert(found.end(), subscribed.begin(), subscribed.end());
        return found;
    };
    EXPECT_EQ(since(Date::distantPast()), (std::vector<CXRecordRef>{friends}));
    EXPECT_TRUE(since(then).empty());
    d.clock.advance(1);
    friends->addMember(a);
    EXPECT_EQ(since(then).size(), 1u) << "a change of its list counts, unsaved";
    d->save();
    EXPECT_EQ(since(then).size(), 1u) << "and saved";
    then = d.clock.now();
    d.clock.advance(1);
    friends->setDistributionIdentifier("x", kCXEmailProperty, a);
    d->save();
    EXPECT_EQ(since(then).size(), 1u) << "and so does a distribution choice";
}

TEST(Search, ComparesValuesOfAllKinds) {
    TestDatabase d;
    CXPersonRef a = d.addPerson("Ada"), b = d.addPerson("Bob");
    CXMutableMultiValue mails, addresses;
    mails.addValue("ADA@example.org", kCXWorkLabel);
    addresses.addValue(Dictionary{{kCXAddressCityKey, "Ulm"}}, kCXHomeLabel);
    a->setValue(mails, kCXEmailProperty);
    b->setValue(addresses, kCXAddressProperty);
    d->save();
    auto find = [&](const char* property, const char* label, const char* key, Value value, int comparison) {
        auto found = d->recordsMatchingSearchElement(
            CXPerson::searchElementForProperty(property, label, key, std::move(value), comparison));
        std::string text;
        for (const auto& r : found) text += r->valueForProperty(kCXFirstNameProperty).string() + " ";
        return text;
    };
    EXPECT_EQ(find(kCXFirstNameProperty, "", "", "Ada", kCXEqual), "Ada ");
    EXPECT_EQ(find(kCXFirstNameProperty, "", "", "Ada", kCXNotEqual), "Bob ");
    EXPECT_EQ(find(kCXFirstNameProperty, "", "", "B", kCXLessThan), "Ada ");
    EXPECT_EQ(find(kCXFirstNameProperty, "", "", "Ada", kCXGreaterThanOrEqual), "Ada Bob ");
    EXPECT_EQ(find(kCXEmailProperty, "", "", "ada@example.ORG", kCXEqualCaseInsensitive), "Ada ");
    EXPECT_EQ(find(kCXEmailProperty, kCXWorkLabel, "", "EXAMPLE", kCXContainsSubStringCaseInsensitive), "Ada ");
    EXPECT_EQ(find(kCXEmailProperty, kCXHomeLabel, "", "example", kCXContainsSubStringCaseInsensitive), "");
    EXPECT_EQ(find(kCXAddressProperty, "", kCXAddressCityKey, "Ulm", kCXEqual), "Bob ");
    EXPECT_EQ(find(kCXBirthdayProperty, "", "", Date(5), kCXGreaterThan), "");
}

TEST(Search, ListsPeopleInOrderAndByText) {
    TestDatabase d;
    for (auto [first, last] : {std::pair{"Zoë", "Álvarez"}, {"Ada", "Byron"}, {"Cy", "aaron"}}) {
        CXPersonRef p = d.addPerson(first);
        p->setValue(last, kCXLastNameProperty);
    }
    d.addSubscribedPerson("Theirs", "http://s/bob/Contacts");
    for (int round = 0; round < 2; round++, d->save()) {
        std::string listed;
        for (const CXListing& l : d->listPeople(RemoteLocation(""))) listed += l.displayName + ",";
        EXPECT_EQ(listed, "Cy aaron,Ada Byron,Zoë Álvarez,");
        EXPECT_EQ(d->listPeople(std::nullopt).size(), 4u);
        ASSERT_EQ(d->listPeople(std::nullopt, "ÁLVA").size(), 1u);
        EXPECT_EQ(d->countPeople(RemoteLocation("http://s/bob/Contacts")), 1u);
    }
    d.addGroup("b");
    d.addGroup("A");
    EXPECT_EQ(d->listGroups(std::nullopt).at(0).displayName, "A");
}

} // namespace
} // namespace rolvane::test
