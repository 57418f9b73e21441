#include "conduits/database/GroupComparison.h"

#include "FakeEngine.h"
#include "contacts/records/Constants.h"

#include <gtest/gtest.h>
#include <rapidcheck.h>

using namespace rolvane;
using namespace rolvane::test;

namespace {

constexpr int32_t kMask = CXDSyncSourceVaultra;
const GroupAddress kOwners{UniqueId("G:CXGroup"), kSelf, kMask, UniqueId("AllCXGroup")};
const GroupAddress kAll{UniqueId("AllCXGroup"), kSelf, kMask, UniqueId("AllCXGroup")};
const GroupAddress kSubscribed{UniqueId("G:CXGroup"), UserName("bob"), kMask, UniqueId("AllCXGroup")};

// Records as in `line`, the places of members' and subgroups' own records as "<member X>" and "<group X>".
Texts steps(const Value& prior, const Value& current, const GroupAddress& address) {
    Texts all;
    for (const GroupStep& step : compareGroupStates(prior, current, address)) {
        if (const auto* record = std::get_if<CXDChangeRecordPtr>(&step)) {
            EXPECT_EQ((*record)->initialSource(), CXDSyncSourceCX);
            all.push_back(line(**record));
        } else if (const auto* member = std::get_if<CaptureMember>(&step)) {
            all.push_back("<member " + member->person.str() + ">");
        } else {
            all.push_back("<group " + std::get<CaptureSubgroup>(step).group.str() + ">");
        }
    }
    return all;
}

CXDChangeRecords records(const Value& prior, const Value& current, const GroupAddress& address) {
    CXDChangeRecords all;
    for (const GroupStep& step : compareGroupStates(prior, current, address))
        if (const auto* record = std::get_if<CXDChangeRecordPtr>(&step)) all.push_back(*record);
    return all;
}

Dictionary state(Array members, const char* name = "Friends", Array subgroups = {}) {
    return {{"memberUIDState", members},
            {"subgroupUIDState", subgroups},
            {kCXGroupNameProperty, name},
            {"distributionListState", Dictionary()}};
}

} // namespace

TEST(GroupComparison, AGroupSeenForTheFirstTimeIsCreatedFilledNamedSharedAndListedInThatOrder) {
    Dictionary current = state({"A", "B"}, "F");
    current.set(kCXReadWriteSharingACLProperty, Array{"bob"});
    current.set(kCXReadSharingACLProperty, Array{"bob", "eve"});
    current.set("distributionListState", Dictionary{{"A", Dictionary{{"Email", "1"}}}, {"B", Dictionary()}});
    EXPECT_EQ(
        steps({}, current, kOwners),
        (Texts{"2 <self> - G:CXGroup 4", "6 <self> G:CXGroup AllCXGroup 4", "<member A>", "5 <self> A G:CXGroup 4",
               "<member B>", "5 <self> B G:CXGroup 4", "4 <self> - G:CXGroup 4", "8 <self> - G:CXGroup 4",
               "7 <self> - G:CXGroup 4", "9 <self> A G:CXGroup 4", "9 <self> B G:CXGroup 4"}));
    const auto made = records({}, current, kOwners);
    EXPECT_EQ(made[0]->payload(), Value(Dictionary{{kCXGroupNameProperty, "F"}}));
    EXPECT_EQ(made[4]->payload(), Value("F"));
    EXPECT_EQ(made[5]->payload(), Value(Dictionary{{"additions", Array{"bob"}}, {"deletions", Array{}}}));
    EXPECT_EQ(made[6]->payload(), Value(Dictionary{{"additions", Array{"bob", "eve"}}, {"deletions", Array{}}}));
    EXPECT_EQ(made[7]->payload(), Value(Dictionary{{"Email", "1"}}));
    EXPECT_EQ(made[8]->payload(), Value(Dictionary{}));
}

TEST(GroupComparison, AnAllContactsGroupSeenForTheFirstTimeIsNotPutIntoItself) {
    EXPECT_EQ(steps({}, state({"A"}), kAll),
              (Texts{"2 <self> - AllCXGroup 4", "<member A>", "5 <self> A AllCXGroup 4"}));
}

TEST(GroupComparison, AGroupOfALocationWithoutAllContactsGroupIsPutIntoNone) {
    GroupAddress address = kSubscribed;
    address.allGroup.reset();
    EXPECT_EQ(steps({}, state({}), address),
              (Texts{"2 bob - G:CXGroup 4", "6 bob G:CXGroup - 4", "4 bob - G:CXGroup 4"}));
}

TEST(GroupComparison, AGroupWithoutANameSeenForTheFirstTimeGetsAnEmptyCreationAndAnEmptyName) {
    const auto made = records({}, Dictionary{{"memberUIDState", Array{}}}, kOwners);
    EXPECT_EQ(lines(made),
              (Texts{"2 <self> - G:CXGroup 4", "6 <self> G:CXGroup AllCXGroup 4", "4 <self> - G:CXGroup 4"}));
    EXPECT_EQ(made[0]->payload(), Value(Dictionary{}));
    EXPECT_EQ(made[2]->payload(), Value(""));
}

TEST(GroupComparison, AVanishedGroupIsDeletedInTheOwnersNameWhoeverPublishesIt) {
    EXPECT_EQ(steps(state({"A"}), {}, kSubscribed), Texts{"261 <self> - G:CXGroup 4"});
}

TEST(GroupComparison, TwoAbsentStatesGiveTheEmptyNameOnly) {
    EXPECT_EQ(steps({}, {}, kOwners), Texts{"4 <self> - G:CXGroup 4"});
    EXPECT_EQ(steps({}, {}, kAll), Texts{});
}

TEST(GroupComparison, EqualStatesGiveNothing) {
    EXPECT_EQ(steps(state({"A", "B"}, "F", {"S"}), state({"A", "B"}, "F", {"S"}), kOwners), Texts{});
}

TEST(GroupComparison, AMemberThatLeftIsTakenOutAndItsListEntryAfterIt) {
    EXPECT_EQ(steps(state({"A", "B"}), state({"B"}), kOwners),
              (Texts{"258 <self> A G:CXGroup 4", "257 <self> A G:CXGroup 4"}));
}

TEST(GroupComparison, AMemberThatLeftTheAllContactsGroupIsDeletedFirst) {
    EXPECT_EQ(steps(state({"A"}), state({}), kAll),
              (Texts{"260 <self> A - 4", "258 <self> A AllCXGroup 4", "257 <self> A AllCXGroup 4"}));
}

TEST(GroupComparison, ASubgroupsOwnChangesComeBeforeItsMembership) {
    EXPECT_EQ(steps(state({}, "F"), state({}, "F", {"S"}), kOwners), (Texts{"<group S>", "6 <self> S G:CXGroup 4"}));
}

TEST(GroupComparison, ASubgroupThatLeftIsTakenOut) {
    EXPECT_EQ(steps(state({}, "F", {"S"}), state({}, "F"), kOwners), Texts{"259 <self> S G:CXGroup 4"});
}

TEST(GroupComparison, ASubgroupThatLeftTheAllContactsGroupIsDeletedFirst) {
    EXPECT_EQ(steps(state({}, "F", {"S"}), state({}, "F"), kAll),
              (Texts{"261 <self> - S 4", "259 <self> S AllCXGroup 4"}));
}

TEST(GroupComparison, ARenamedGroupCarriesItsNewName) {
    const auto made = records(state({}, "Old"), state({}, "New"), kOwners);
    EXPECT_EQ(lines(made), Texts{"4 <self> - G:CXGroup 4"});
    EXPECT_EQ(made[0]->payload(), Value("New"));
}

TEST(GroupComparison, ANameThatTheDatabaseGaveToAGroupWithoutOneIsNobodysEdit) {
    const Dictionary nameless{{"memberUIDState", Array()}, {"subgroupUIDState", Array()}};
    const Dictionary given = state({}, "untitled group");
    EXPECT_EQ(steps(nameless, given, kOwners), Texts{});
    EXPECT_EQ(steps(nameless, state({}, "Friends"), kOwners), Texts{"4 <self> - G:CXGroup 4"});
    EXPECT_EQ(steps(state({}, "Friends"), given, kOwners), Texts{"4 <self> - G:CXGroup 4"}) << "somebody has typed it";
}

TEST(GroupComparison, RenamingTheAllContactsGroupGivesNothing) {
    EXPECT_EQ(steps(state({}, "Old"), state({}, "New"), kAll), Texts{});
}

TEST(GroupComparison, TheAllContactsGroupsDistributionListsAreNeverCompared) {
    Dictionary current = state({});
    current.set("distributionListState", Dictionary{{"A", Dictionary{{"Email", "1"}}}});
    EXPECT_EQ(steps(state({}), current, kAll), Texts{});
}

TEST(GroupComparison, ASubscribedGroupNeverYieldsAccessListRecords) {
    Dictionary current = state({});
    current.set(kCXReadWriteSharingACLProperty, Array{"ada"});
    current.set(kCXReadSharingACLProperty, Array{"ada"});
    EXPECT_EQ(steps(state({}), current, kSubscribed), Texts{});
    EXPECT_EQ(steps(state({}), current, kOwners).size(), 2u);
}

TEST(GroupComparison, AnAccessListWhoseOrderAloneChangesGivesNothing) {
    Dictionary prior = state({}), current = state({});
    prior.set(kCXReadSharingACLProperty, Array{"bob", "eve"});
    current.set(kCXReadSharingACLProperty, Array{"eve", "bob"});
    EXPECT_EQ(steps(prior, current, kOwners), Texts{});
}

TEST(GroupComparison, AnAccessListThatVanishedCarriesItsDeletions) {
    Dictionary prior = state({});
    prior.set(kCXReadWriteSharingACLProperty, Array{"bob"});
    const auto made = records(prior, state({}), kOwners);
    EXPECT_EQ(lines(made), Texts{"8 <self> - G:CXGroup 4"});
    EXPECT_EQ(made[0]->payload(), Value(Dictionary{{"additions", Array{}}, {"deletions", Array{"bob"}}}));
}

TEST(GroupComparison, AChangedChoiceCarriesThePersonsWholeChoices) {
    Dictionary prior = state({"A"}), current = state({"A"});
    prior.set("distributionListState", Dictionary{{"A", Dictionary{{"Email", "1"}, {"Phone", "7"}}}});
    current.set("distributionListState", Dictionary{{"A", Dictionary{{"Email", "2"}, {"Phone", "7"}}}});
    const auto made = records(prior, current, kOwners);
    EXPECT_EQ(lines(made), Texts{"9 <self> A G:CXGroup 4"});
    EXPECT_EQ(made[0]->payload(), Value(Dictionary{{"Email", "2"}, {"Phone", "7"}}));
}

TEST(GroupComparison, ChoicesOfAPersonThatLeftGiveNothing) {
    Dictionary prior = state({});
    prior.set("distributionListState", Dictionary{{"A", Dictionary{{"Email", "1"}}}});
    EXPECT_EQ(steps(prior, state({}), kOwners), Texts{});
}

namespace {

// The rules word by word, on plain vectors.
Texts literally(const std::vector<int>& before, const std::vector<int>& after, bool allGroup) {
    const std::string group = allGroup ? "AllCXGroup" : "G:CXGroup";
    Texts all;
    const auto has = [](const std::vector<int>& list, int n) {
        return std::find(list.begin(), list.end(), n) != list.end();
    };
    for (size_t i = 0; i < after.size(); ++i) {
        if (has(before, after[i])) continue;
        const std::string m = "m" + std::to_string(after[i]);
        all.push_back("<member " + m + ">");
        all.push_back("5 <self> " + m + " " + group + " 4");
    }
    for (int n : before) {
        if (has(after, n)) continue;
        const std::string m = "m" + std::to_string(n);
        if (allGroup) all.push_back("260 <self> " + m + " - 4");
        all.push_back("258 <self> " + m + " " + group + " 4");
        all.push_back("257 <self> " + m + " " + group + " 4");
    }
    return all;
}

} // namespace

TEST(GroupComparison, MatchesTheRulesWordByWordForRandomMembers) {
    EXPECT_TRUE(rc::check([](bool allGroup) {
        const auto list = rc::gen::unique<std::vector<int>>(rc::gen::inRange(0, 30));
        const std::vector<int> before = *list, after = *list;
        const auto array = [](const std::vector<int>& from) {
            Array members;
            for (int n : from) members.append("m" + std::to_string(n));
            return members;
        };
        RC_ASSERT(steps(state(array(before)), state(array(after)), allGroup ? kAll : kOwners) ==
                  literally(before, after, allGroup));
    }));
}
