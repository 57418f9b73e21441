#include "model/CXDChangeRecord.h"

#include "contacts/records/Constants.h"
#include "foundation/CXException.h"
#include "model/PayloadKeys.h"

#include <gtest/gtest.h>

namespace rolvane {
namespace {

const UniqueId kGroup{"G1:CXGroup"};

CXDChangeRecord change(int32_t type, const char* person = nullptr, Value payload = {}) {
    std::optional<UniqueId> member;
    if (person) member = UniqueId(person);
    CXDChangeRecord r(CXDSyncSourceCX, type, kSelf, member, kGroup, std::move(payload));
    r.setAppliesToSources(CXDSyncSourceVaultra);
    return r;
}

std::vector<int32_t> masks(const CXDChangeRecords& records) {
    std::vector<int32_t> all;
    for (const CXDChangeRecordPtr& r : records) all.push_back(r->appliesToSources());
    return all;
}

// The payload of an empty composite after the changes were merged into it, in order.
Value merged(std::vector<CXDChangeRecord> changes) {
    CXDChangeRecord composite = change(CXDCompositeGroupChange);
    for (CXDChangeRecord& c : changes) composite.mergeWithGroupChangeRecord(c);
    EXPECT_EQ(composite.type(), CXDCompositeGroupChange);
    return composite.inMemoryPayload();
}

TEST(Splitting, GivesOneRecordASourceInAFixedOrderWithoutThePeerSource) {
    CXDChangeRecord r = change(CXDAddRecordToGroup, "P1");
    r.setAppliesToSources(31);
    EXPECT_EQ(masks(r.splitChangeRecord()), (std::vector<int32_t>{2, 4, 1, 16}));
}

TEST(Splitting, ARecordForThePeerSourceAloneSplitsIntoNothing) {
    CXDChangeRecord r = change(CXDAddRecordToGroup, "P1");
    r.setAppliesToSources(8);
    EXPECT_TRUE(r.splitChangeRecord().empty());
}

TEST(Splitting, PartsAreCopiesThatShareThePayloadObject) {
    CXDChangeRecord r = change(CXDCompositeGroupChange, "P1", Dictionary{{"a", 1}});
    r.setAppliesToSources(5);
    r.setAppliedToSources(2);
    const CXDChangeRecords parts = r.splitChangeRecord();
    ASSERT_EQ(parts.size(), 2u);
    parts[0]->payload().dictionary().set("b", 2);
    EXPECT_EQ(parts[1]->payload(), r.payload());
    EXPECT_EQ(r.payload(), Value(Dictionary{{"a", 1}, {"b", 2}}));
    EXPECT_EQ(parts[0]->appliedToSources(), 0);
    EXPECT_EQ(parts[0]->person(), r.person());
    EXPECT_EQ(parts[0]->type(), CXDCompositeGroupChange);
    EXPECT_EQ(r.appliesToSources(), 5) << "the record that was split stays as it was";
}

TEST(Merging, TakesTheNameOfACreationAndOfARenaming) {
    EXPECT_EQ(merged({change(CXDCreateStructureForGroup, nullptr, Dictionary{{kCXGroupNameProperty, "Friends"}})}),
              Value(Dictionary{{kCXGroupNameProperty, "Friends"}}));
    EXPECT_EQ(merged({change(CXDChangeGroupName, nullptr, "Family")}),
              Value(Dictionary{{kCXGroupNameProperty, "Family"}}));
}

TEST(Merging, ListsAnAddedOrRemovedMemberOnce) {
    EXPECT_EQ(merged({change(CXDAddRecordToGroup, "P1"), change(CXDAddRecordToGroup, "P2"),
                      change(CXDAddRecordToGroup, "P1")}),
              Value(Dictionary{{kMemberAdds, Array{"P1", "P2"}}}));
    EXPECT_EQ(merged({change(CXDRemoveRecordFromGroup, "P1"), change(CXDRemoveRecordFromGroup, "P1")}),
              Value(Dictionary{{kMemberRemoves, Array{"P1"}}}));
}

TEST(Merging, ListsAnAddedOrRemovedSubgroupOnce) {
    EXPECT_EQ(merged({change(CXDAddGroupToGroup, "G2"), change(CXDAddGroupToGroup, "G2")}),
              Value(Dictionary{{kSubgroupAdds, Array{"G2"}}}));
    EXPECT_EQ(merged({change(CXDRemoveGroupFromGroup, "G2"), change(CXDRemoveGroupFromGroup, "G2")}),
              Value(Dictionary{{kSubgroupRemoves, Array{"G2"}}}));
}

TEST(Merging, AnAdditionDoesNotCancelARemovalNorTheOtherWayRound) {
    EXPECT_EQ(merged({change(CXDAddRecordToGroup, "P1"), change(CXDRemoveRecordFromGroup, "P1")}),
              Value(Dictionary{{kMemberAdds, Array{"P1"}}, {kMemberRemoves, Array{"P1"}}}));
}

TEST(Merging, KeepsTheLatestDistributionValueAPersonAndRepeatsRemovals) {
    EXPECT_EQ(merged({change(CXDUpdateDistributionList, "P1", "home"), change(CXDUpdateDistributionList, "P2", "work"),
                      change(CXDUpdateDistributionList, "P1", "mobile")}),
              Value(Dictionary{{kDistributionListAdds, Dictionary{{"P1", "mobile"}, {"P2", "work"}}}}));
    EXPECT_EQ(
        merged({change(CXDRemoveDistributionListFromGroup, "P1"), change(CXDRemoveDistributionListFromGroup, "P1")}),
        Value(Dictionary{{kDistributionListRemoves, Array{"P1", "P1"}}}));
}

TEST(Merging, AGroupDeletionLeavesACompositeWithoutPayload) {
    EXPECT_FALSE(merged({change(CXDAddRecordToGroup, "P1"), change(CXDDeleteGroup)}));
}

TEST(Merging, AfterAGroupDeletionStartsAnEmptyPayloadAgain) {
    EXPECT_EQ(merged({change(CXDAddRecordToGroup, "P1"), change(CXDDeleteGroup), change(CXDAddRecordToGroup, "P2")}),
              Value(Dictionary{{kMemberAdds, Array{"P2"}}}));
}

TEST(Merging, OtherTypesChangeNothingButTheType) {
    for (const int32_t type : {1, 3, 7, 8, 260, 99}) {
        CXDChangeRecord receiver = change(CXDAddRecordToGroup, "P9");
        CXDChangeRecord other(CXDSyncSourceVaultra, type, UserName("bob"), UniqueId("P1"), UniqueId("G2"),
                              Dictionary{{kMemberAdds, Array{"P1"}}});
        receiver.mergeWithGroupChangeRecord(other);
        EXPECT_EQ(receiver.type(), CXDCompositeGroupChange);
        EXPECT_EQ(receiver.inMemoryPayload(), Value(Dictionary{})) << type;
        EXPECT_EQ(receiver.person(), UniqueId("P9"));
        EXPECT_EQ(receiver.group(), kGroup);
        EXPECT_EQ(receiver.user(), kSelf);
        EXPECT_EQ(receiver.initialSource(), CXDSyncSourceCX);
        EXPECT_EQ(receiver.appliesToSources(), CXDSyncSourceVaultra);
    }
}

TEST(Merging, AMembershipChangeWithoutAPersonChangesNothingButTheType) {
    for (const int32_t type : {5, 6, 258, 259}) EXPECT_EQ(merged({change(type)}), Value(Dictionary{})) << type;
}

TEST(Merging, RefusesWhatWouldStoreSomethingAbsentAndChangesNothing) {
    for (CXDChangeRecord bad :
         {change(CXDCreateStructureForGroup), change(CXDCreateStructureForGroup, nullptr, Dictionary{}),
          change(CXDChangeGroupName), change(CXDUpdateDistributionList, nullptr, "home"),
          change(CXDUpdateDistributionList, "P1"), change(CXDRemoveDistributionListFromGroup)}) {
        CXDChangeRecord receiver = change(CXDAddRecordToGroup, "P9");
        EXPECT_FALSE(bad.canBeMerged()) << bad.description();
        EXPECT_THROW(receiver.mergeWithGroupChangeRecord(bad), CXException) << bad.description();
        EXPECT_EQ(receiver.type(), CXDAddRecordToGroup);
        EXPECT_FALSE(receiver.inMemoryPayload());
    }
}

TEST(Merging, WhatItAcceptsIsWhatCanBeMerged) {
    for (CXDChangeRecord good :
         {change(CXDCreateStructureForGroup, nullptr, Dictionary{{kCXGroupNameProperty, "x"}}),
          change(CXDChangeGroupName, nullptr, "x"), change(CXDUpdateDistributionList, "P1", "home"),
          change(CXDRemoveDistributionListFromGroup, "P1"), change(CXDAddRecordToGroup), change(CXDDeleteGroup)}) {
        CXDChangeRecord receiver = change(CXDCompositeGroupChange);
        EXPECT_TRUE(good.canBeMerged()) << good.description();
        EXPECT_NO_THROW(receiver.mergeWithGroupChangeRecord(good)) << good.description();
    }
}

TEST(OutOfOrder, WaitsForContactDatabaseAndAccessListChangesOnly) {
    const auto can = [](int32_t type, int32_t mask) {
        CXDChangeRecord r = change(type);
        r.setAppliesToSources(mask);
        return r.canApplyOutOfOrder();
    };
    EXPECT_TRUE(can(CXDUpdateRecord, 4));
    EXPECT_FALSE(can(CXDUpdateRecord, 5));
    EXPECT_FALSE(can(CXDChangeGroupReadACL, 4));
    EXPECT_FALSE(can(CXDChangeGroupReadWriteACL, 4));
    EXPECT_TRUE(can(CXDDeleteGroup, 6));
    EXPECT_TRUE(can(CXDUpdateRecord, 0));
}

TEST(DataOwner, IsTheSelfMarkerAndNobodyElse) {
    const auto owner = [](std::optional<UserName> user) {
        return CXDChangeRecord(1, 1, std::move(user), std::nullopt, std::nullopt).changeMadeByDataOwner();
    };
    EXPECT_TRUE(owner(UserName("<self>")));
    EXPECT_FALSE(owner(UserName("ann")));
    EXPECT_FALSE(owner(std::nullopt));
}

// Answers with what it was asked.
class EchoLocator : public RecordLocator {
public:
    std::optional<RemoteLocation> baseLocation(int32_t source, const std::optional<UserName>& user) const override {
        if (source == 5) return std::nullopt;
        return RemoteLocation(std::to_string(source) + ":" + (user ? user->str() : "nobody"));
    }
};

TEST(RemoteLocationOfARecord, IsThatOfItsInitialSource) {
    CXDChangeRecord r(CXDSyncSourceVaultra, 1, UserName("ann"), std::nullopt, std::nullopt);
    r.setAppliesToSources(1);
    EXPECT_EQ(r.remoteLocation(EchoLocator()), RemoteLocation("4:ann"));
}

TEST(RemoteLocationOfARecord, OfTheContactDatabaseIsThatOfTheWholeAppliesToMask) {
    CXDChangeRecord r = change(CXDUpdateRecord, "P1");
    r.setAppliesToSources(4);
    EXPECT_EQ(r.remoteLocation(EchoLocator()), RemoteLocation("4:<self>"));
    r.setAppliesToSources(5);
    EXPECT_EQ(r.remoteLocation(EchoLocator()), std::nullopt) << "no conduit, no location";
}

} // namespace
} // namespace rolvane
