#include "engine/queue/TakenOut.h"

#include "Records.h"
#include "contacts/records/Constants.h"
#include "model/PayloadKeys.h"

#include <gtest/gtest.h>

namespace rolvane::test {
namespace {

constexpr RecordShape here(const char* user) {
    return {CXDSyncSourceCX, CXDSyncSourceVaultra, user};
}
constexpr RecordShape there(const char* user) {
    return {CXDSyncSourceVaultra, CXDSyncSourceCX, user};
}

CXDChangeRecords left(CXDChangeRecords records) {
    TakenOut(records).drop(records);
    return records;
}

// What is left of a pass in the end. Of somebody else's publication the changes that arrive are left until it is known
// whether the deletion was let through.
void expectOnlyLeft(const CXDChangeRecords& records, const CXDChangeRecords& expected) {
    const TakenOut takenOut(records);
    CXDChangeRecords rest = records;
    takenOut.drop(rest);
    if (!records[0]->changeMadeByDataOwner()) {
        EXPECT_EQ(rest, records);
    }
    std::erase_if(rest, [&](const CXDChangeRecordPtr& record) { return takenOut.concerns(*record); });
    EXPECT_EQ(rest, expected);
}

class WhatIsTakenOut : public testing::TestWithParam<const char*> {};
INSTANTIATE_TEST_SUITE_P(Users, WhatIsTakenOut, testing::Values("<self>", "ann"),
                         [](const auto& user) { return user.index == 0 ? "Own" : "AnothersTree"; });

TEST_P(WhatIsTakenOut, NothingIsDroppedWhereNothingIsTakenOut) {
    const CXDChangeRecords records = {
        makeRecord(CXDUpdateRecord, "P1:CXPerson", nullptr, here(GetParam())),
        makeRecord(CXDUpdateRecord, "P1:CXPerson", nullptr, there(GetParam())),
        makeRecord(CXDRemoveRecordFromGroup, "P1:CXPerson", "G1:CXGroup", there(GetParam())),
        makeRecord(CXDAddRecordToGroup, "P1:CXPerson", "G1:CXGroup", here(GetParam()))};
    EXPECT_EQ(left(records), records);
}

TEST_P(WhatIsTakenOut, OfAGroupThatTheStoreHasNoLongerNoChangeOfItsOwnIsLeft) {
    const auto removal = makeRecord(CXDRemoveGroupFromGroup, "G1:CXGroup", "AllCXGroup", there(GetParam()));
    const auto member = makeRecord(CXDRemoveRecordFromGroup, "P1:CXPerson", "G1:CXGroup", there(GetParam()));
    const auto other = makeRecord(CXDAddRecordToGroup, "P2:CXPerson", "G2:CXGroup", here(GetParam()));
    CXDChangeRecords records = {makeRecord(CXDAddRecordToGroup, "P2:CXPerson", "G1:CXGroup", here(GetParam())),
                                makeRecord(CXDChangeGroupName, nullptr, "G1:CXGroup", here(GetParam())),
                                makeRecord(CXDUpdateDistributionList, "P2:CXPerson", "G1:CXGroup", here(GetParam())),
                                makeRecord(CXDCompositeGroupChange, nullptr, "G1:CXGroup", here(GetParam())),
                                makeRecord(CXDAddGroupToGroup, "G1:CXGroup", "G2:CXGroup", here(GetParam())),
                                other,
                                member,
                                removal};
    EXPECT_EQ(left(records), (CXDChangeRecords{other, member, removal}));
}

TEST_P(WhatIsTakenOut, OfAGroupThatIsDeletedHereNoChangeOnTheStoreIsTakenIn) {
    const auto deletion = makeRecord(CXDDeleteGroup, nullptr, "G1:CXGroup", here(GetParam()));
    CXDChangeRecords records = {
        deletion, makeRecord(CXDAddRecordToGroup, "P1:CXSubscribedPerson", "G1:CXSubscribedGroup", there(GetParam())),
        makeRecord(CXDRemoveRecordFromGroup, "P2:CXPerson", "G1:CXGroup", there(GetParam())),
        makeRecord(CXDChangeGroupName, nullptr, "G1:CXGroup", there(GetParam()))};
    expectOnlyLeft(records, {deletion});
}

// A group's file keeps what it says of a member for some time behind the member's deletion.
TEST_P(WhatIsTakenOut, WhatGroupsOfTheStoreStillSayOfSomebodyWhomItsListHasLostCountsForNothing) {
    const auto removal = makeRecord(CXDRemoveRecordFromGroup, "P1:CXPerson", "AllCXGroup", there(GetParam()));
    const auto other = makeRecord(CXDUpdateDistributionList, "P2:CXPerson", "G1:CXGroup", there(GetParam()));
    const auto choice = makeRecord(CXDUpdateDistributionList, "P1:CXPerson", "G1:CXGroup", there(GetParam()));
    const auto member = makeRecord(CXDAddRecordToGroup, "P1:CXSubscribedPerson", "G1:CXGroup", there(GetParam()));
    const auto content = makeRecord(CXDUpdateRecord, "P1:CXSubscribedPerson", nullptr, there(GetParam()));
    const auto leaving = makeRecord(CXDRemoveRecordFromGroup, "P1:CXPerson", "G2:CXGroup", there(GetParam()));
    EXPECT_EQ(left({removal, other, leaving, choice, content, member}), (CXDChangeRecords{removal, other, leaving}));
    const auto ofAnother = makeRecord(CXDUpdateDistributionList, "P1:CXPerson", "G1:CXGroup", there("zoe"));
    EXPECT_EQ(left({removal, ofAnother}), (CXDChangeRecords{removal, ofAnother}));
}

TEST_P(WhatIsTakenOut, AContactThatOneSideTakesOutIsOutOnBoth) {
    const auto removal = makeRecord(CXDRemoveRecordFromGroup, "P1:CXPerson", "AllCXGroup", there(GetParam()));
    const auto leaving = makeRecord(CXDRemoveRecordFromGroup, "P1:CXPerson", "G1:CXGroup", here(GetParam()));
    EXPECT_EQ(left({makeRecord(CXDUpdateRecord, "P1:CXPerson", nullptr, here(GetParam())),
                    makeRecord(CXDAddRecordToGroup, "P1:CXPerson", "G1:CXGroup", here(GetParam())), leaving, removal}),
              (CXDChangeRecords{leaving, removal}));
    const auto deletion = makeRecord(CXDDeleteRecord, "P1:CXPerson", nullptr, here(GetParam()));
    expectOnlyLeft({deletion, makeRecord(CXDUpdateRecord, "P1:CXSubscribedPerson", nullptr, there(GetParam())),
                    makeRecord(CXDUpdateDistributionList, "P1:CXPerson", "G1:CXGroup", there(GetParam()))},
                   {deletion});
}

TEST_P(WhatIsTakenOut, WhatBothTakeOutIsTakenOutByBoth) {
    const CXDChangeRecords records = {
        makeRecord(CXDDeleteGroup, nullptr, "G1:CXGroup", here(GetParam())),
        makeRecord(CXDRemoveGroupFromGroup, "G1:CXGroup", "AllCXGroup", here(GetParam())),
        makeRecord(CXDRemoveGroupFromGroup, "G1:CXGroup", "AllCXGroup", there(GetParam())),
        makeRecord(CXDDeleteRecord, "P1:CXPerson", nullptr, here(GetParam())),
        makeRecord(CXDRemoveRecordFromGroup, "P1:CXPerson", "AllCXGroup", there(GetParam()))};
    EXPECT_EQ(left(records), records);
}

TEST_P(WhatIsTakenOut, WhatOneSideTakesOutAndMakesAgainStays) {
    const CXDChangeRecords records = {makeRecord(CXDDeleteGroup, nullptr, "G1:CXGroup", here(GetParam())),
                                      makeRecord(CXDCreateStructureForGroup, nullptr, "G1:CXGroup", here(GetParam()))};
    EXPECT_EQ(left(records), records);
}

TEST_P(WhatIsTakenOut, ATreeOfSomebodyElseIsNotConcerned) {
    const CXDChangeRecords records = {makeRecord(CXDDeleteGroup, nullptr, "G1:CXGroup", here(GetParam())),
                                      makeRecord(CXDChangeGroupName, nullptr, "G1:CXGroup", there("zoe"))};
    EXPECT_EQ(left(records), records);
}

TEST_P(WhatIsTakenOut, AWaitingChangeOfAGroupForgetsTheMembersThatAreOut) {
    const auto waiting = makeRecord(CXDCompositeGroupChange, nullptr, "G1:CXGroup", here(GetParam()));
    waiting->setPayload(Dictionary{{kMemberAdds, Array{"P1:CXPerson", "P2:CXPerson"}}, {kCXGroupNameProperty, "Ours"}});
    const auto removal = makeRecord(CXDRemoveRecordFromGroup, "P1:CXPerson", "AllCXGroup", there(GetParam()));
    EXPECT_EQ(left({waiting, removal}), (CXDChangeRecords{waiting, removal}));
    EXPECT_EQ(waiting->payload(),
              Value(Dictionary{{kMemberAdds, Array{"P2:CXPerson"}}, {kCXGroupNameProperty, "Ours"}}));
}

} // namespace
} // namespace rolvane::test
