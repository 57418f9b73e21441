#include "conduits/store/TreeCondition.h"

#include "conduits/store/StoreComparison.h"
#include "model/PayloadKeys.h"

#include <gtest/gtest.h>

namespace rolvane::test {
namespace {

using Kind = TreeCondition::Kind;

constexpr Date kNow{1'800'000'000};

// A tree with two contacts and a group of one of them.
Dictionary tree(Date visited = kNow, Date made = kNow.addingSeconds(-1000)) {
    Dictionary people;
    for (const char* person : {"a:CXPerson", "b:CXPerson"})
        people.set(person, Dictionary{{kModificationDate, kNow.addingSeconds(-500)}});
    return {{kSerialNumber, "one"},
            {kTreeDates, Dictionary{{"info", made}, {"dateFile", visited}}},
            {kPeopleState, Dictionary{{kMemberUIDState, people}}},
            {"AllCXGroup",
             Dictionary{{kMemberUIDState, Array{"a:CXPerson", "b:CXPerson"}}, {kSubgroupUIDState, Array{"G:CXGroup"}}}},
            {"G:CXGroup", Dictionary{{kMemberUIDState, Array{"a:CXPerson"}}}}};
}
Kind kindOf(const Dictionary& prior, const Dictionary& current, std::optional<Date> lastVisit = std::nullopt) {
    const TreeCondition condition = treeCondition(prior, current, lastVisit);
    EXPECT_EQ(condition.isSound(), condition.sentence.empty());
    return condition.kind;
}
Dictionary without(Dictionary state, const char* key) {
    state.remove(key);
    return state;
}

TEST(TreeCondition, WhatIsAsItWasOrHasGrownOrIsNotKnownYetIsSound) {
    EXPECT_EQ(kindOf(tree(), tree()), Kind::sound);
    EXPECT_EQ(kindOf(tree(), tree(kNow.addingSeconds(300))), Kind::sound) << "its owner has been there";
    EXPECT_EQ(kindOf(tree(), tree(), kNow), Kind::sound);
    EXPECT_EQ(kindOf({}, tree()), Kind::sound);
    EXPECT_EQ(kindOf({}, {}), Kind::sound);
    EXPECT_EQ(kindOf(without(tree(), kTreeDates), tree(kNow.addingSeconds(-9999))), Kind::sound);
    EXPECT_EQ(kindOf(tree(), without(tree(), kTreeDates)), Kind::sound) << "a store that gives no dates";
}

TEST(TreeCondition, AClockFileOlderThanBeforeIsASetback) {
    EXPECT_EQ(kindOf(tree(), tree(kNow.addingSeconds(-1))), Kind::setBack);
    EXPECT_EQ(kindOf(tree(), tree(kNow.addingSeconds(-0.5))), Kind::sound) << "dates count to the second";
    EXPECT_EQ(kindOf(without(tree(), kTreeDates), tree(), kNow.addingSeconds(1)), Kind::setBack)
        << "older than at the owner's last visit";
}

TEST(TreeCondition, AnotherDateOfTheInformationIsASetbackToo) {
    for (const double seconds : {-1.0, 1.0, 5000.0})
        EXPECT_EQ(kindOf(tree(), tree(kNow, kNow.addingSeconds(-1000 + seconds))), Kind::setBack) << seconds;
}

TEST(TreeCondition, ATreeThatWasSetBackIsWaitedForUntilItsOwnerHasBeenThere) {
    for (const Date made : {kNow.addingSeconds(-1000), kNow.addingSeconds(7)}) {
        Dictionary prior = tree();
        const Dictionary copy = tree(kNow.addingSeconds(-100), made);
        ASSERT_EQ(kindOf(prior, copy), Kind::setBack);
        for (int look = 0; look < 3; ++look) {
            prior.set(kTreeDates, datesToWaitFor(copy));
            EXPECT_EQ(kindOf(prior, copy), Kind::setBack);
        }
        EXPECT_EQ(kindOf(prior, tree(kNow.addingSeconds(-50), made)), Kind::sound);
    }
}

TEST(TreeCondition, ALostListOfEverybodyIsALossToTheOwnerAndToOthersOnlyWithoutAnyContact) {
    const Dictionary lost = without(tree(), "AllCXGroup");
    EXPECT_EQ(kindOf(tree(), lost), Kind::sound);
    EXPECT_EQ(kindOf(tree(), lost, kNow), Kind::lostLists);
    EXPECT_EQ(kindOf(tree(), without(lost, kPeopleState)), Kind::lostLists);
    EXPECT_EQ(kindOf(without(tree(), "AllCXGroup"), lost, kNow), Kind::sound) << "there never was one";
}

TEST(TreeCondition, AListThatIsThereAndNamesNobodyAtAllIsALossAndAnEmptyOneIsNot) {
    Dictionary current = tree();
    current.set("AllCXGroup", Dictionary());
    EXPECT_EQ(kindOf(tree(), current), Kind::lostLists);
    for (const Value& noList : {Value("nobody"), Value(7), Value(Dictionary())}) {
        current.set("AllCXGroup", Dictionary{{kMemberUIDState, noList}});
        EXPECT_EQ(kindOf(tree(), current), Kind::lostLists) << "what is no list says nothing";
    }
    current.set("AllCXGroup", Dictionary{{kMemberUIDState, Array()}});
    EXPECT_EQ(kindOf(tree(), current), Kind::sound) << "its owner has deleted everybody, one file is on its way out";
    for (const Value& people : {Value(), Value(Dictionary{{kMemberUIDState, Dictionary()}})}) {
        people ? current.set(kPeopleState, people) : current.remove(kPeopleState);
        EXPECT_EQ(kindOf(tree(), current), Kind::sound) << "its owner has deleted everybody";
        EXPECT_EQ(kindOf(tree(), current, kNow), Kind::sound) << "a writer has";
    }
    current.remove("G:CXGroup");
    EXPECT_EQ(kindOf(tree(), current), Kind::sound) << "and the last group";
    current.dictionaryFor("AllCXGroup").set(kSubgroupUIDState, Array{"G:CXGroup"});
    EXPECT_EQ(kindOf(tree(), current), Kind::lostAGroup) << "which is listed";
}

TEST(TreeCondition, AnotherListIsALossWhereAllWhomItNamedBeforeStillLieThere) {
    const auto naming = [](const Array& members) {
        Dictionary state = tree();
        state.set("AllCXGroup", Dictionary{{kMemberUIDState, members}});
        return state;
    };
    EXPECT_EQ(kindOf(tree(), naming({"c:CXPerson"})), Kind::replacedList);
    EXPECT_EQ(kindOf(tree(), naming({"a:CXPerson", "c:CXPerson"})), Kind::sound) << "somebody left";
    EXPECT_EQ(kindOf(tree(), naming({})), Kind::sound) << "an emptied list";
    Dictionary deleted = naming({"c:CXPerson"});
    deleted.set(kPeopleState,
                Dictionary{{kMemberUIDState, Dictionary{{"a:CXPerson", Dictionary()}, {"c:CXPerson", Dictionary()}}}});
    EXPECT_EQ(kindOf(tree(), deleted), Kind::sound) << "they are being deleted";
    Dictionary one = tree();
    one.set("AllCXGroup", Dictionary{{kMemberUIDState, Array{"a:CXPerson"}}});
    EXPECT_EQ(kindOf(one, naming({"c:CXPerson"})), Kind::sound) << "of one contact nobody can tell";
}

TEST(TreeCondition, AGroupThatIsGoneAndStillNamedIsALossAndADeletedOneIsNot) {
    Dictionary current = without(tree(), "G:CXGroup");
    EXPECT_EQ(kindOf(tree(), current), Kind::lostAGroup);
    current.set("G:CXGroup", Dictionary());
    EXPECT_EQ(kindOf(tree(), current), Kind::lostAGroup) << "its folder is left";
    current.set("AllCXGroup", Dictionary{{kMemberUIDState, Array{"a:CXPerson", "b:CXPerson"}}});
    EXPECT_EQ(kindOf(tree(), current), Kind::sound);
}

TEST(TreeCondition, AGroupThatTheListOfEverybodyDoesNotNameWasDeletedThoughAnotherGroupNamesIt) {
    const auto with = [](Array listed, bool isThere) {
        Dictionary state = tree();
        state["AllCXGroup"].dictionary().set(kSubgroupUIDState, std::move(listed));
        state.set("H:CXGroup", Dictionary{{kMemberUIDState, Array()}, {kSubgroupUIDState, Array{"G:CXGroup"}}});
        if (!isThere) state.remove("G:CXGroup");
        return state;
    };
    const Dictionary before = with(Array{"G:CXGroup", "H:CXGroup"}, true);
    EXPECT_EQ(kindOf(before, with(Array{"H:CXGroup"}, false)), Kind::sound);
    EXPECT_EQ(kindOf(with(Array{"H:CXGroup"}, true), with(Array{"H:CXGroup"}, false)), Kind::sound)
        << "seen while it was being deleted";
    EXPECT_EQ(kindOf(before, with(Array{"G:CXGroup", "H:CXGroup"}, false)), Kind::lostAGroup);
    EXPECT_EQ(kindOf(with(Array(), true), with(Array(), false)), Kind::lostAGroup)
        << "where single groups are published the list of everybody need not name any";
}

TEST(TreeCondition, AGroupThatIsNowhereIsTakenOutOfTheGroupsThatNameIt) {
    const auto nobody = [](const UniqueId&) { return false; };
    Dictionary before = tree(), now = without(tree(), "G:CXGroup");
    now["AllCXGroup"].dictionary().set(kSubgroupUIDState, Array{"H:CXGroup"});
    now.set("H:CXGroup", Dictionary{{kMemberUIDState, Array()}, {kSubgroupUIDState, Array{"G:CXGroup"}}});
    const Dictionary alone = namesAlone(before, now, nobody);
    EXPECT_EQ(alone, (Dictionary{{"H:CXGroup", Array{"G:CXGroup"}}}));
    const CXDChangeRecords removals = removalOfNamesAlone(before, alone, {}, kNow);
    ASSERT_EQ(removals.size(), 1u) << "the list named it before";
    EXPECT_EQ(removals[0]->type(), CXDRemoveGroupFromGroup);
    EXPECT_EQ(removals[0]->person(), UniqueId("G:CXGroup"));
    EXPECT_EQ(removals[0]->group(), UniqueId("H:CXGroup"));
    EXPECT_TRUE(removalOfNamesAlone(now, namesAlone(now, now, nobody), {}, kNow).empty()) << "it may be still to come";
    Dictionary seen = now;
    seen.set(kNamesAlone, namesTogether({}, alone, {}, kNow));
    EXPECT_TRUE(
        removalOfNamesAlone(seen, namesAlone(seen, now, nobody), {}, kNow.addingSeconds(kPatience - 1)).empty());
    EXPECT_EQ(removalOfNamesAlone(seen, namesAlone(seen, now, nobody), {}, kNow.addingSeconds(kPatience)).size(), 1u)
        << "it does not come";
    EXPECT_TRUE(namesAlone(now, now, [](const UniqueId&) { return true; }).empty()) << "the owner has it";
    now["AllCXGroup"].dictionary().remove(kSubgroupUIDState);
    EXPECT_TRUE(namesAlone(now, now, nobody).empty()) << "single groups are published";
}

TEST(TreeCondition, ANameOfEverybodysListWithoutAContactIsTakenOutWhenItStandsForAWeek) {
    Dictionary now = tree();
    const auto isHere = [](const UniqueId& uid) { return uid.str() != "gone:CXPerson"; };
    EXPECT_TRUE(namesAlone(now, now, isHere).empty());
    Array names = now["AllCXGroup"].dictionary()[kMemberUIDState].array().mutableCopy();
    names.append("gone:CXPerson");
    now.dictionaryFor("AllCXGroup").set(kMemberUIDState, names);
    const Dictionary alone = namesAlone(tree(), now, isHere);
    EXPECT_EQ(alone, (Dictionary{{"AllCXGroup", Array{"gone:CXPerson"}}}));
    EXPECT_TRUE(removalOfNamesAlone(now, alone, {}, kNow).empty()) << "somebody is deleting it";
    Dictionary seen = now;
    seen.set(kNamesAlone, namesTogether({}, alone, {}, kNow));
    EXPECT_TRUE(removalOfNamesAlone(seen, alone, {}, kNow.addingSeconds(kPatience - 1)).empty()) << "it may come yet";
    const CXDChangeRecords removals = removalOfNamesAlone(seen, alone, {}, kNow.addingSeconds(kPatience));
    ASSERT_EQ(removals.size(), 1u);
    EXPECT_EQ(removals[0]->type(), CXDRemoveRecordFromGroup);
    EXPECT_EQ(removals[0]->person(), UniqueId("gone:CXPerson"));
    EXPECT_EQ(removals[0]->group(), UniqueId("AllCXGroup"));
}

TEST(TreeCondition, WhatAnEarlierVersionRememberedBeginsItsWeekNow) {
    const Dictionary alone{{"AllCXGroup", Array{"gone:CXPerson"}}};
    Dictionary seen = tree();
    seen.set(kNamesAlone, alone); // without dates
    EXPECT_TRUE(removalOfNamesAlone(seen, alone, {}, kNow).empty());
    EXPECT_EQ(namesTogether(alone, alone, {}, kNow), (Dictionary{{"AllCXGroup", Dictionary{{"gone:CXPerson", kNow}}}}));
    const Dictionary circles{{"C:CXGroup", Array{"A:CXGroup"}}};
    seen.set(kNamesAlone, circles);
    EXPECT_EQ(removalOfNamesAlone(seen, {}, circles, kNow).size(), 1u);
}

TEST(TreeCondition, AContactIsUnlistedWhereNoGroupNamesIt) {
    Dictionary state = tree();
    const auto unlisted = [&](const std::vector<UniqueId>& candidates = {}) {
        return contactsThatAreUnlisted(state, candidates);
    };
    EXPECT_TRUE(unlisted({UniqueId("a:CXPerson"), UniqueId("nowhere:CXPerson")}).empty());
    Dictionary people = state[kPeopleState].dictionary()[kMemberUIDState].dictionary();
    people.set("c:CXPerson", Dictionary{{kModificationDate, kNow}});
    EXPECT_EQ(unlisted(), std::vector{UniqueId("c:CXPerson")});
    state["G:CXGroup"].dictionary().set(kMemberUIDState, Array{"c:CXPerson"});
    EXPECT_TRUE(unlisted().empty()) << "single groups may be published";
    state["G:CXGroup"].dictionary().set(kMemberUIDState, Array());
    people.remove("a:CXPerson"); // as many as are listed
    EXPECT_TRUE(unlisted().empty());
    EXPECT_EQ(unlisted({UniqueId("c:CXPerson")}), std::vector{UniqueId("c:CXPerson")});
    state["AllCXGroup"].dictionary().remove(kMemberUIDState);
    EXPECT_TRUE(unlisted({UniqueId("c:CXPerson")}).empty()) << "no list, no judgement";
}

TEST(TreeCondition, ANameIsNowhereWhereNeitherAFileNorAListHasIt) {
    const Dictionary state{{kPeopleState, Dictionary{{kMemberUIDState, Dictionary{{"file:CXPerson", Dictionary()}}}}},
                           {"AllCXGroup", Dictionary{{kMemberUIDState, Array{"listed:CXPerson"}},
                                                     {kSubgroupUIDState, Array{"L:CXGroup"}}}},
                           {"G:CXGroup", Dictionary{{kMemberUIDState, Array{"member:CXPerson"}},
                                                    {kSubgroupUIDState, Array{"S:CXGroup"}}}}};
    std::vector<UniqueId> asked;
    for (const char* name : {"file:CXPerson", "listed:CXPerson", "member:CXPerson", "gone:CXPerson", "L:CXGroup",
                             "S:CXGroup", "G:CXGroup", "gone:CXGroup"})
        asked.emplace_back(name);
    EXPECT_EQ(namesThatAreNowhere(state, asked), (std::vector{UniqueId("gone:CXPerson"), UniqueId("gone:CXGroup")}));
    EXPECT_TRUE(namesThatAreNowhere(state, {}).empty());
    state["AllCXGroup"].dictionary().remove(kMemberUIDState);
    EXPECT_TRUE(namesThatAreNowhere(state, asked).empty()) << "no list, no judgement";
}

TEST(TreeCondition, AContactThatIsKnownByGroupsAloneHasLeftOne) {
    Dictionary prior = tree(), now = tree();
    prior["G:CXGroup"].dictionary().set(kMemberUIDState, Array{"a:CXPerson", "x:CXPerson", "y:CXPerson"});
    now["G:CXGroup"].dictionary().set(kMemberUIDState, Array{"y:CXPerson", "z:CXPerson"});
    EXPECT_EQ(unlistedContactsThatLeftAGroup(prior, now), std::vector{UniqueId("x:CXPerson")}) << "a is listed";
    EXPECT_EQ(unlistedContactsThatLeftAGroup(prior, without(now, "G:CXGroup")).size(), 2u);
    EXPECT_TRUE(unlistedContactsThatLeftAGroup(prior, prior).empty());
    EXPECT_TRUE(unlistedContactsThatLeftAGroup({}, now).empty());
}

TEST(TreeCondition, ContactsThatHaveLeftThisPersonsDatabaseAreDeletedAndNotLost) {
    const auto nobodyIsHere = [](const UniqueId&) { return false; };
    const auto oneIsHere = [](const UniqueId& uid) { return uid.str() == "a:CXPerson"; };
    const Dictionary empty = without(tree(), kPeopleState);
    EXPECT_EQ(treeCondition(tree(), empty, std::nullopt, oneIsHere).kind, Kind::lostContacts);
    EXPECT_TRUE(treeCondition(tree(), empty, std::nullopt, nobodyIsHere).isSound());
    Dictionary another = tree();
    another.set("AllCXGroup",
                Dictionary{{kMemberUIDState, Array{"c:CXPerson"}}, {kSubgroupUIDState, Array{"G:CXGroup"}}});
    EXPECT_EQ(treeCondition(tree(), another, std::nullopt).kind, Kind::replacedList);
    EXPECT_TRUE(treeCondition(tree(), another, std::nullopt, oneIsHere).isSound());
}

TEST(TreeCondition, AGroupThatHasLeftItsOwnersDatabaseAndTheTreeIsDeletedThoughEverybodysListNamesIt) {
    const Dictionary now = without(tree(), "G:CXGroup");
    const auto isHere = [](const UniqueId& uid) { return uid.str() != "G:CXGroup"; };
    EXPECT_EQ(kindOf(tree(), now), Kind::lostAGroup);
    EXPECT_TRUE(treeCondition(tree(), now, std::nullopt, isHere).isSound());
    const Dictionary alone = namesAlone(tree(), now, isHere);
    EXPECT_EQ(alone, (Dictionary{{"AllCXGroup", Array{"G:CXGroup"}}}));
    EXPECT_TRUE(removalOfNamesAlone(tree(), alone, {}, kNow).empty()) << "somebody is deleting it";
    Dictionary seen = tree();
    seen.set(kNamesAlone, namesTogether({}, alone, {}, kNow));
    const CXDChangeRecords removals = removalOfNamesAlone(seen, alone, {}, kNow);
    ASSERT_EQ(removals.size(), 1u);
    EXPECT_EQ(removals[0]->type(), CXDRemoveGroupFromGroup);
    EXPECT_EQ(removals[0]->person(), UniqueId("G:CXGroup"));
    seen.remove("G:CXGroup");
    EXPECT_TRUE(removalOfNamesAlone(seen, alone, {}, kNow).empty()) << "it may be new";
}

TEST(TreeCondition, WhatClosesACircleInTheOwnersDatabaseIsTakenOutWhenItStandsForTwoVisits) {
    std::map<UniqueId, std::vector<UniqueId>> here{{UniqueId("A:CXGroup"), {UniqueId("B:CXGroup")}},
                                                   {UniqueId("B:CXGroup"), {UniqueId("C:CXGroup")}}};
    const auto inner = [&](const UniqueId& group) { return here[group]; };
    Dictionary state = tree();
    const auto holds = [&](const char* group, const Array& groups) {
        state.set(group, Dictionary{{kSubgroupUIDState, groups}});
    };
    holds("A:CXGroup", {"B:CXGroup"});
    holds("B:CXGroup", {"C:CXGroup"});
    EXPECT_TRUE(closingCircles(state, inner).empty());
    holds("C:CXGroup", {"A:CXGroup", "D:CXGroup"});
    const Dictionary circles = closingCircles(state, inner);
    EXPECT_EQ(circles, (Dictionary{{"C:CXGroup", Array{"A:CXGroup"}}}));
    EXPECT_TRUE(removalOfNamesAlone(state, {}, circles, kNow).empty()) << "somebody is turning them round";
    state.set(kNamesAlone, namesTogether({}, {}, circles, kNow));
    const CXDChangeRecords removals = removalOfNamesAlone(state, {}, circles, kNow);
    ASSERT_EQ(removals.size(), 1u);
    EXPECT_EQ(removals[0]->person(), UniqueId("A:CXGroup"));
    EXPECT_EQ(removals[0]->group(), UniqueId("C:CXGroup"));
    here[UniqueId("A:CXGroup")].clear();
    EXPECT_TRUE(closingCircles(state, inner).empty()) << "the owner has taken the other half back";
}

TEST(TreeCondition, ContactsWithoutASingleFileAreALoss) {
    Dictionary current = without(tree(), kPeopleState);
    EXPECT_EQ(kindOf(tree(), current), Kind::lostContacts);
    current.dictionaryFor("AllCXGroup").set(kMemberUIDState, Array{"b:CXPerson"});
    EXPECT_EQ(kindOf(tree(), current), Kind::lostContacts) << "one is left, its list says";
    current.set(kPeopleState, Dictionary{{kMemberUIDState, Dictionary{{"a:CXPerson", Dictionary()}}}});
    EXPECT_EQ(kindOf(tree(), current), Kind::sound) << "one that is away is nobody's news";
}

TEST(TreeCondition, WhatTheOwnerDoesNotKnowIsTakenOffTheStoreAndNothingElse) {
    EXPECT_TRUE(removalOfLeftovers(tree(), tree()).empty());
    Dictionary current = Value(tree()).deepMutableCopy().dictionary();
    current.dictionaryFor("AllCXGroup").arrayFor(kMemberUIDState).append("old:CXPerson");
    current.dictionaryFor("AllCXGroup").arrayFor(kSubgroupUIDState).append("H:CXGroup");
    current.dictionaryFor("G:CXGroup").arrayFor(kMemberUIDState).append("b:CXPerson");
    current.dictionaryFor(kPeopleState).dictionaryFor(kMemberUIDState).set("old:CXPerson", Dictionary());
    current.set("H:CXGroup", Dictionary{{kMemberUIDState, Array{"old:CXPerson"}}});
    std::vector<std::string> seen;
    for (const CXDChangeRecordPtr& record : removalOfLeftovers(tree(), current)) {
        EXPECT_EQ(record->user(), kSelf);
        EXPECT_EQ(record->initialSource(), CXDSyncSourceCX);
        EXPECT_EQ(record->appliesToSources(), CXDSyncSourceVaultra);
        std::string text = std::to_string(record->type());
        if (record->person()) text += " " + record->person()->str();
        if (record->group()) text += " " + record->group()->str();
        for (const char* key : {kMemberRemoves, kSubgroupRemoves})
            for (const Value& each : record->payload().dictionary()[key].array()) text += " -" + each.string();
        seen.push_back(text);
    }
    EXPECT_EQ(seen, (std::vector<std::string>{"3 AllCXGroup -old:CXPerson -H:CXGroup", "3 G:CXGroup -b:CXPerson",
                                              "261 H:CXGroup", "260 old:CXPerson"}));
}

} // namespace
} // namespace rolvane::test
