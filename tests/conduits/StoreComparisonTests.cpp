#include "conduits/store/StoreComparison.h"

#include "FakeEngine.h"
#include "LiteralComparison.h"

#include <gtest/gtest.h>
#include <rapidcheck/gtest.h>

using namespace rolvane;
using namespace rolvane::test;

namespace {

const Date kLastSync(1'800'000'000);

StoreUser bob(bool isNew = false, bool mayWrite = false) {
    StoreUser who;
    who.user = UserName("bob");
    who.base = RemoteLocation("http://store/bob/Contacts");
    who.source = CXDSyncSourceVaultra;
    who.isNew = isNew;
    who.lastSyncDate = kLastSync;
    who.mayWrite = [mayWrite] { return mayWrite; };
    who.contactUpdate = [](const UniqueId& contact) {
        auto record =
            std::make_shared<CXDChangeRecord>(CXDSyncSourceVaultra, CXDUpdateRecord, UserName("bob"),
                                              cxUIDWithTableName(contact, "CXSubscribedPerson"), std::nullopt);
        record->setAppliesToSources(CXDSyncSourceCX);
        return record;
    };
    return who;
}

Dictionary dated(std::initializer_list<std::pair<const char*, double>> contacts) {
    Dictionary people;
    for (const auto& [contact, offset] : contacts)
        people.set(contact, Dictionary{{"modificationdate", kLastSync.addingSeconds(offset)}});
    return {{"People", Dictionary{{"memberUIDState", people}}}};
}

Dictionary withGroup(const char* name, Dictionary state) {
    return {{name, state}};
}

// With the payload, for the records whose payload says something; the identifiers of multi-values are left out.
std::string whole(const CXDChangeRecord& record) {
    std::string text = line(record) + " from " + std::to_string(record.initialSource());
    const Value payload = record.inMemoryPayload();
    if (const Dictionary* entries = payload.dictionaryIf()) {
        for (const auto& [key, value] : *entries) {
            const auto multi = CXMultiValue::fromValue(value);
            text += " " + key + "=" + (multi ? multi->valueAtIndex(0).string() : value.description());
        }
    } else if (payload) {
        text += " '" + payload.string() + "'";
    }
    return text;
}
Texts whole(const CXDChangeRecords& records) {
    Texts all;
    for (const auto& record : records) all.push_back(whole(*record));
    return all;
}

rc::Gen<std::vector<int>> someNumbers(int below) {
    return rc::gen::scale(0.1, rc::gen::container<std::vector<int>>(rc::gen::inRange(0, below)));
}

Array someIdentifiers(const char* table) {
    Array all;
    for (const int number : *someNumbers(7)) all.append(std::to_string(number) + ":" + table);
    return all;
}

Dictionary someGroup() {
    Dictionary state, choices;
    for (const int person : *someNumbers(5))
        choices.set(std::to_string(person) + ":CXPerson",
                    Dictionary{{"Email", std::to_string(*rc::gen::inRange(0, 3))}});
    if (*rc::gen::arbitrary<bool>()) state.set("memberUIDState", someIdentifiers("CXPerson"));
    if (*rc::gen::arbitrary<bool>()) state.set("subgroupUIDState", someIdentifiers("CXGroup"));
    if (*rc::gen::arbitrary<bool>()) state.set("distributionListState", choices);
    if (const int name = *rc::gen::inRange(0, 4)) state.set(kCXGroupNameProperty, std::to_string(name));
    return state;
}

Dictionary someState() {
    Dictionary state, people;
    for (const int contact : *someNumbers(9)) {
        const int offset = *rc::gen::inRange(0, 9); // 0: without a date
        people.set(std::to_string(contact) + ":CXPerson",
                   offset ? Dictionary{{"modificationdate", kLastSync.addingSeconds(offset)}} : Dictionary());
    }
    state.set("People", Dictionary{{"memberUIDState", people}});
    for (const int group : *someNumbers(4))
        state.set(group ? std::to_string(group) + ":CXGroup" : "AllCXGroup", someGroup());
    return state;
}

} // namespace

RC_GTEST_PROP(StoreComparison, GivesWhatTheLiteralComparisonGives, ()) {
    const Dictionary prior = someState(), current = someState();
    StoreUser who = bob(*rc::gen::arbitrary<bool>(), *rc::gen::arbitrary<bool>());
    if (*rc::gen::arbitrary<bool>()) who.user = kSelf;
    if (*rc::gen::inRange(0, 4) == 0) who.lastSyncDate.reset();
    RC_ASSERT(whole(compareStoreStates(prior, current, who)) == whole(literalComparison(prior, current, who)));
}

// -- contacts

TEST(StoreComparison, AUserNewToTheConduitYieldsAnUpdateForEveryContactWhateverItsDate) {
    Dictionary current = dated({{"a:CXPerson", -1000}, {"b:CXPerson", 1000}});
    current["People"].dictionary()["memberUIDState"].dictionary().set("c:CXPerson", Dictionary());
    EXPECT_EQ(
        lines(compareStoreStates({}, current, bob(true))),
        (Texts{"1 bob a:CXSubscribedPerson - 1", "1 bob b:CXSubscribedPerson - 1", "1 bob c:CXSubscribedPerson - 1"}));
}

TEST(StoreComparison, AContactModifiedFourSecondsAfterTheLastSyncIsNotUpdatedAndOneAMillisecondLaterIs) {
    const Dictionary current = dated({{"four:CXPerson", 4.0}, {"later:CXPerson", 4.001}, {"before:CXPerson", -1}});
    EXPECT_EQ(lines(compareStoreStates({}, current, bob())), Texts{"1 bob later:CXSubscribedPerson - 1"});
}

TEST(StoreComparison, WithoutALastSyncAKnownUserYieldsNoContactUpdates) {
    StoreUser who = bob();
    who.lastSyncDate.reset();
    EXPECT_TRUE(compareStoreStates({}, dated({{"a:CXPerson", 1000}}), who).empty());
}

TEST(StoreComparison, AContactThatIsNotListedAnyMoreIsNotDeleted) {
    const Dictionary prior = dated({{"a:CXPerson", 10}, {"b:CXPerson", 10}});
    EXPECT_TRUE(compareStoreStates(prior, dated({}), bob()).empty());
}

// -- groups

TEST(StoreComparison, ANewGroupIsMadeAndFilledAndNamedOnceMore) {
    const Dictionary current =
        withGroup("G:CXGroup", {{"memberUIDState", Array{"a:CXPerson"}},
                                {"subgroupUIDState", Array{"H:CXGroup"}},
                                {kCXGroupNameProperty, "Friends"},
                                {"distributionListState", Dictionary{{"a:CXPerson", Dictionary{{"Email", "1"}}}}}});
    const CXDChangeRecords records = compareStoreStates({}, current, bob());
    EXPECT_EQ(lines(records),
              (Texts{"2 bob - G:CXSubscribedGroup 1", "1 bob a:CXSubscribedPerson - 1",
                     "5 bob a:CXSubscribedPerson G:CXSubscribedGroup 1", "6 bob H:CXGroup G:CXSubscribedGroup 1",
                     "9 bob a:CXPerson G:CXSubscribedGroup 1", "4 bob - G:CXSubscribedGroup 1"}));
    const Dictionary payload = records[0]->inMemoryPayload().dictionary();
    EXPECT_EQ(payload.count(), 2u);
    EXPECT_EQ(payload[kCXGroupNameProperty], Value("Friends"));
    const auto location = CXMultiValue::fromValue(payload[kCXRemoteLocationProperty]);
    ASSERT_TRUE(location && location->count() == 1);
    EXPECT_EQ(location->valueAtIndex(0), Value("http://store/bob/Contacts"));
    EXPECT_EQ(location->labelAtIndex(0), kCXSubscribeLabel);
    EXPECT_EQ(records[5]->inMemoryPayload(), Value("Friends"));
}

TEST(StoreComparison, ANewGroupWhereTheAccountMayWriteSaysSo) {
    const auto records = compareStoreStates({}, withGroup("G:CXGroup", {}), bob(false, true));
    EXPECT_EQ(records[0]->inMemoryPayload().dictionary()[kCXReadWriteSharingACLProperty], Value("bob"));
}

TEST(StoreComparison, ANewGroupOfTheOwnersKeepsItsIdentifierAndHasNoLocation) {
    StoreUser who = bob();
    who.user = kSelf;
    const auto records = compareStoreStates({}, withGroup("G:CXGroup", {}), who);
    ASSERT_EQ(lines(records), Texts{"2 <self> - G:CXGroup 1"});
    EXPECT_EQ(records[0]->inMemoryPayload(), Value(Dictionary()));
}

TEST(StoreComparison, AKnownGroupIsNamedAsItStandsInTheStore) {
    const Dictionary prior =
        withGroup("G:CXGroup", {{"memberUIDState", Array{"a:CXPerson", "b:CXPerson"}}, {kCXGroupNameProperty, "F"}});
    const Dictionary current =
        withGroup("G:CXGroup", {{"memberUIDState", Array{"b:CXPerson", "c:CXPerson"}}, {kCXGroupNameProperty, "E"}});
    EXPECT_EQ(lines(compareStoreStates(prior, current, bob())),
              (Texts{"1 bob c:CXSubscribedPerson - 1", "5 bob c:CXSubscribedPerson G:CXGroup 1",
                     "258 bob a:CXPerson G:CXGroup 1", "4 bob - G:CXGroup 1"}));
}

TEST(StoreComparison, TheAllContactsGroupYieldsMembershipsButNeverANameOrDistributionLists) {
    const Dictionary current =
        withGroup("AllCXGroup", {{"memberUIDState", Array{"a:CXPerson"}},
                                 {"subgroupUIDState", Array{"H:CXGroup"}},
                                 {kCXGroupNameProperty, "Everybody"},
                                 {"distributionListState", Dictionary{{"a:CXPerson", Dictionary{{"Email", "1"}}}}}});
    EXPECT_EQ(lines(compareStoreStates(withGroup("AllCXGroup", {}), current, bob())),
              (Texts{"1 bob a:CXSubscribedPerson - 1", "5 bob a:CXSubscribedPerson AllCXGroup 1",
                     "6 bob H:CXGroup AllCXGroup 1"}));
    EXPECT_EQ(lines(compareStoreStates({}, current, bob())),
              (Texts{"2 bob - AllCXSubscribedGroup 1", "1 bob a:CXSubscribedPerson - 1",
                     "5 bob a:CXSubscribedPerson AllCXSubscribedGroup 1", "6 bob H:CXGroup AllCXSubscribedGroup 1"}));
}

TEST(StoreComparison, AGroupOnlyInThePriorStateYieldsARemovalForEachMemberAndSubgroupAndNothingElse) {
    const Dictionary prior =
        withGroup("G:CXGroup", {{"memberUIDState", Array{"a:CXPerson", "b:CXPerson"}},
                                {"subgroupUIDState", Array{"H:CXGroup"}},
                                {kCXGroupNameProperty, "F"},
                                {"distributionListState", Dictionary{{"a:CXPerson", Dictionary{{"Email", "1"}}}}}});
    EXPECT_EQ(
        lines(compareStoreStates(prior, {}, bob())),
        (Texts{"258 bob a:CXPerson G:CXGroup 1", "258 bob b:CXPerson G:CXGroup 1", "259 bob H:CXGroup G:CXGroup 1"}));
}

TEST(StoreComparison, NothingChangedYieldsNothing) {
    Dictionary state = dated({{"a:CXPerson", 1}});
    state.set("G:CXGroup", Dictionary{{"memberUIDState", Array{"a:CXPerson"}}, {kCXGroupNameProperty, "F"}});
    EXPECT_TRUE(compareStoreStates(state, state, bob()).empty());
}

TEST(StoreComparison, WhatIsOfAnotherKindThanExpectedCountsAsAbsent) {
    const Dictionary current{{"People", Array{1}},
                             {"G:CXGroup", Dictionary{{"memberUIDState", Array{1, Dictionary(), "", "a:CXPerson"}},
                                                      {"subgroupUIDState", Dictionary{{"H:CXGroup", 1}}},
                                                      {kCXGroupNameProperty, Array{"F"}},
                                                      {"distributionListState", "lists"}}}};
    EXPECT_EQ(lines(compareStoreStates({}, current, bob())),
              (Texts{"2 bob - G:CXSubscribedGroup 1", "1 bob a:CXSubscribedPerson - 1",
                     "5 bob a:CXSubscribedPerson G:CXSubscribedGroup 1"}));
}

// -- the two differences

TEST(StoreComparison, AGroupsDifferenceKeepsTheOrdersOfItsSides) {
    const Dictionary difference =
        groupDifference(Dictionary{{"memberUIDState", Array{"z", "y", "x"}}, {"subgroupUIDState", Array{"s"}}},
                        Dictionary{{"memberUIDState", Array{"c", "y", "a"}}, {kCXGroupNameProperty, "N"}});
    EXPECT_EQ(difference["memberAdds"], Value(Array{"c", "a"}));
    EXPECT_EQ(difference["memberRemoves"], Value(Array{"z", "x"}));
    EXPECT_EQ(difference["subgroupAdds"], Value(Array()));
    EXPECT_EQ(difference["subgroupRemoves"], Value(Array{"s"}));
    EXPECT_EQ(difference["nameChanges"], Value(Array{"N"}));
    EXPECT_EQ(difference["distributionListUpdates"], Value(Dictionary()));
    EXPECT_EQ(difference["distributionListRemoves"], Value(Array()));
}

// Somebody may have written such a name into a list. It would make a copy that hides the record itself.
TEST(StoreComparison, ANameOfACopyInAListCountsAsAbsent) {
    const Dictionary difference = groupDifference(
        Dictionary{{"memberUIDState", Array{"b:CXPerson"}}},
        Dictionary{{"memberUIDState", Array{"b:CXSubscribedPerson", "a:CXPerson", "b:CXPerson"}},
                   {"subgroupUIDState", Array{"AllCXSubscribedGroup", "s:CXSubscribedGroup", "t:CXGroup"}}});
    EXPECT_EQ(difference["memberAdds"], Value(Array{"a:CXPerson"}));
    EXPECT_EQ(difference["memberRemoves"], Value(Array()));
    EXPECT_EQ(difference["subgroupAdds"], Value(Array{"t:CXGroup"}));
}

TEST(StoreComparison, TwoAbsentGroupsDifferInNothing) {
    for (const auto& [key, value] : groupDifference({}, {}))
        EXPECT_TRUE(value.array().empty() && value.dictionary().empty()) << key;
}

TEST(StoreComparison, ADistributionListDifferenceUpdatesWhatIsNewOrOtherAndListsWhatIsGone) {
    const Dictionary prior{{"same", 1}, {"other", 1}, {"gone", 1}}, current{{"same", 1}, {"other", 2}, {"new", 3}};
    const Dictionary difference = distributionListDifference(prior, current);
    EXPECT_EQ(difference["distributionListUpdates"], Value(Dictionary{{"new", 3}, {"other", 2}}));
    EXPECT_EQ(difference["distributionListRemoves"], Value(Array{"gone"}));
}

// Quadratic, this would take minutes.
TEST(StoreComparison, AHundredThousandMembersAreComparedAtOnce) {
    Array before, now;
    for (int i = 0; i < 100000; ++i) {
        before.append(std::to_string(i) + ":CXPerson");
        now.append(std::to_string(i + 10) + ":CXPerson");
    }
    const Dictionary difference =
        groupDifference(Dictionary{{"memberUIDState", before}}, Dictionary{{"memberUIDState", now}});
    EXPECT_EQ(difference["memberAdds"].array().count(), 10u);
    EXPECT_EQ(difference["memberRemoves"].array().count(), 10u);
}
