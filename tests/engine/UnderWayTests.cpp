#include "EngineWorld.h"

#include "contacts/records/Constants.h"
#include "engine/memory/EngineState.h"
#include "engine/recovery/UnderWay.h"
#include "model/PayloadKeys.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <set>

namespace rolvane {
namespace {

using test::makeRecord;
using test::World;
using testing::IsEmpty;
using testing::UnorderedElementsAre;

constexpr const char* kPerson = "P:CXPerson";
constexpr const char* kGroup = "G:CXGroup";
constexpr const char* kAll = "AllCXGroup";

// Passes of an owner whose list of all is published. What the store takes is noted as "identifier type".
class LeftUnsettled : public testing::Test {
protected:
    LeftUnsettled() {
        world.start();
        for (const char* conduit : {kConduitCX, kConduitVaultra})
            world.engine->conduitObjectForKey(conduit, kPriorState)
                .set("<self>",
                     Dictionary{{kAll, Dictionary{{kMemberUIDState, Array()}, {kSubgroupUIDState, Array()}}}});
        world.vaultra->whenApplying = [this](const CXDChangeRecordPtr& r, bool*) {
            const std::lock_guard guard(lock);
            if (refused.contains(r->type())) return false;
            applied.insert((r->person() ? r->person()->str() : r->group()->str()) + " " + std::to_string(r->type()));
            if (r->type() == CXDCompositeGroupChange) written = r->inMemoryPayload().deepMutableCopy().dictionary();
            return true;
        };
    }
    CXDChangeRecordPtr own(int32_t type, const char* person, const char* group, Value payload = {}) {
        return makeRecord(type, person, group, {CXDSyncSourceCX, CXDSyncSourceVaultra, "<self>"}, std::move(payload));
    }
    std::multiset<std::string> pass(const CXDChangeRecords& records = {}) {
        applied.clear();
        written = Dictionary();
        world.engine->applyChangeRecords(records);
        return applied;
    }
    // Of two waiting changes of a group that are equal but for their contents one is dropped.
    void loseTheQueue() { world.engine->setPendingChanges({}); }

    World world;
    std::mutex lock;
    std::set<int32_t> refused;
    std::multiset<std::string> applied;
    Dictionary written;
};

TEST_F(LeftUnsettled, APersonWhoWasWrittenAndNeverListedIsRemovedAfterLeaving) {
    world.rolvane->addRecord(CXPerson::initWithUniqueId(UniqueId(kPerson)));
    world.rolvane->save();
    refused = {CXDCompositeGroupChange};
    EXPECT_THAT(pass({own(CXDUpdateRecord, kPerson, nullptr), own(CXDAddRecordToGroup, kPerson, kAll)}),
                UnorderedElementsAre("P:CXPerson 1"));
    loseTheQueue();
    refused.clear();
    EXPECT_THAT(pass(), IsEmpty()) << "the person is there";
    world.rolvane->removeRecord(world.rolvane->recordForUniqueId(UniqueId(kPerson)));
    world.rolvane->save();
    EXPECT_THAT(pass(), UnorderedElementsAre("P:CXPerson 260", "AllCXGroup 3")) << "and out of the list";
    EXPECT_EQ(written[kMemberRemoves], Value(Array{kPerson})) << "which may have been written, too";
    EXPECT_THAT(pass(), IsEmpty()) << "once";
    EXPECT_FALSE(world.stored(kCXDUnderWay));
}

TEST_F(LeftUnsettled, AGroupThatWasWrittenAndNeverListedIsRemovedAfterLeaving) {
    refused = {CXDCompositeGroupChange};
    const Value name = Dictionary{{kCXGroupNameProperty, "Friends"}};
    pass({own(CXDCreateStructureForGroup, nullptr, kGroup, name), own(CXDAddGroupToGroup, kGroup, kAll)});
    loseTheQueue();
    refused.clear();
    EXPECT_THAT(pass(), UnorderedElementsAre("G:CXGroup 261", "AllCXGroup 3"));
    EXPECT_TRUE(written[kSubgroupRemoves].array().containsString(kGroup));
    EXPECT_THAT(pass(), IsEmpty());
    EXPECT_FALSE(world.stored(kCXDUnderWay));
}

// As while the store's refusal of it rests: the store may have the name, and the group get another one meanwhile.
TEST_F(LeftUnsettled, TheNameOfANewGroupStaysNotedBehindAPassThatDoesNotSpeakOfIt) {
    world.rolvane->addRecord(CXGroup::initWithUniqueId(UniqueId(kGroup)));
    world.rolvane->save();
    refused = {CXDCompositeGroupChange};
    const Value name = Dictionary{{kCXGroupNameProperty, "Friends"}};
    pass({own(CXDCreateStructureForGroup, nullptr, kGroup, name), own(CXDAddGroupToGroup, kGroup, kAll)});
    loseTheQueue();
    refused.clear();
    pass();
    const Dictionary groups = world.stored(kCXDUnderWay).dictionary()["<self>"].dictionary()["groups"].dictionary();
    EXPECT_EQ(groups[kGroup].dictionary()["names"], Value(Array{"Friends"})) << Value(groups).description();
}

TEST_F(LeftUnsettled, AGroupStaysNotedWhereAFoldHasLostAnEarlierChangeOfIt) {
    for (const char* conduit : {kConduitCX, kConduitVaultra})
        world.engine->conduitObjectForKey(conduit, kPriorState)["<self>"]
            .dictionary()[kAll]
            .dictionary()[kSubgroupUIDState]
            .array()
            .append(Value(kGroup));
    pass({own(CXDCompositeGroupChange, nullptr, kGroup, Dictionary{{kMemberAdds, Array{kPerson}}}),
          own(CXDAddRecordToGroup, "Q:CXPerson", kGroup)});
    const auto noted = [&] {
        return world.stored(kCXDUnderWay).dictionary()["<self>"].dictionary()["groups"].dictionary();
    };
    EXPECT_TRUE(noted().contains(kGroup));
    pass({own(CXDAddRecordToGroup, "R:CXPerson", kGroup)});
    EXPECT_FALSE(noted().contains(kGroup));
}

TEST_F(LeftUnsettled, ARemovalThatStillWaitsIsSentAgainWhenItIsLost) {
    refused = {CXDDeleteRecord};
    pass({own(CXDDeleteRecord, kPerson, nullptr)});
    EXPECT_THAT(world.pending(), UnorderedElementsAre("P:CXPerson:4"));
    refused.clear();
    EXPECT_THAT(pass(), UnorderedElementsAre("P:CXPerson 260"));
    EXPECT_THAT(pass(), IsEmpty());
}

// What a killed pass had listed and the person took back.
TEST_F(LeftUnsettled, WhoIsToBeTakenOutOfAListStaysNotedUntilThatIsDone) {
    world.preferences.set(kDaemonDomain, kCXDUnderWay,
                          Dictionary{{"groups", Dictionary{{kAll, Dictionary{{kMemberAdds, Array{kPerson}}}}}}});
    refused = {CXDCompositeGroupChange};
    EXPECT_THAT(pass(), IsEmpty());
    loseTheQueue();
    refused.clear();
    EXPECT_THAT(pass(), UnorderedElementsAre("AllCXGroup 3"));
    EXPECT_TRUE(written[kMemberRemoves].array().containsString(kPerson));
    EXPECT_THAT(pass(), IsEmpty());
    EXPECT_FALSE(world.stored(kCXDUnderWay));
}

TEST_F(LeftUnsettled, AnAccessListThatIsLostBesideARemovalIsSentByTheNextPass) {
    world.preferences.set(kDaemonDomain, kCXDUnderWay,
                          Dictionary{{"groups", Dictionary{{kAll, Dictionary{{kMemberAdds, Array{kPerson}}}}}}});
    const auto rights = [&] {
        return own(CXDChangeGroupReadACL, nullptr, kAll, Dictionary{{kAdditions, Array{"bob"}}});
    };
    EXPECT_THAT(pass({rights()}), UnorderedElementsAre("AllCXGroup 3"));
    EXPECT_TRUE(written[kMemberRemoves].array().containsString(kPerson));
    EXPECT_FALSE(world.stored(kCXDUnderWay))
        << "the next pass would take the person out again, and lose the list again";
    EXPECT_THAT(pass({rights()}), UnorderedElementsAre("AllCXGroup 7"));
}

TEST_F(LeftUnsettled, NothingIsLeftOfAPassThatDidEverything) {
    world.rolvane->addRecord(CXPerson::initWithUniqueId(UniqueId(kPerson)));
    world.rolvane->save();
    pass({own(CXDUpdateRecord, kPerson, nullptr), own(CXDAddRecordToGroup, kPerson, kAll)});
    EXPECT_FALSE(world.stored(kCXDUnderWay));
}

TEST_F(LeftUnsettled, WithdrawingTheListOfAllEndsIt) {
    refused = {CXDCompositeGroupChange};
    pass({own(CXDUpdateRecord, kPerson, nullptr), own(CXDAddRecordToGroup, kPerson, kAll)});
    EXPECT_TRUE(world.stored(kCXDUnderWay));
    refused.clear();
    loseTheQueue();
    EXPECT_THAT(pass({own(CXDDeleteGroup, nullptr, kAll)}), UnorderedElementsAre("AllCXGroup 261", "P:CXPerson 260"));
    EXPECT_FALSE(world.stored(kCXDUnderWay));
}

// Every subscriber's copy has a list of all, but that of single groups is nobody's list of who is published.
TEST_F(LeftUnsettled, NothingIsLeftOfAPassWhereSingleGroupsArePublished) {
    world.rolvane->allGroup()->setValue(CXMultiValue(), kCXRemoteLocationProperty);
    world.rolvane->addRecord(CXPerson::initWithUniqueId(UniqueId(kPerson)));
    world.rolvane->save();
    const Value name = Dictionary{{kCXGroupNameProperty, "Friends"}};
    pass({own(CXDUpdateRecord, kPerson, nullptr), own(CXDCreateStructureForGroup, nullptr, kGroup, name),
          own(CXDAddRecordToGroup, kPerson, kGroup)});
    EXPECT_FALSE(world.stored(kCXDUnderWay));
}

// What waits for somebody else's list of all, or for a source that no pass writes to, can wait for ever.
TEST_F(LeftUnsettled, WhatWaitsElsewhereKeepsNothingOfTheOwnersOwn) {
    world.vaultra->whenApplying = [](const CXDChangeRecordPtr& r, bool*) { return r->user() == kSelf; };
    world.rolvane->addRecord(CXPerson::initWithUniqueId(UniqueId(kPerson)));
    world.rolvane->save();
    pass({makeRecord(CXDAddRecordToGroup, "B:CXPerson", kAll, {CXDSyncSourceCX, CXDSyncSourceVaultra, "bob"}),
          makeRecord(CXDAddRecordToGroup, kPerson, kAll, {CXDSyncSourceCX, CXDSyncSourceLocal, "<self>"})});
    EXPECT_EQ(world.pending().size(), 2U);
    pass({own(CXDUpdateRecord, kPerson, nullptr), own(CXDAddRecordToGroup, kPerson, kAll)});
    EXPECT_EQ(world.pending().size(), 2U);
    EXPECT_FALSE(world.stored(kCXDUnderWay));
}

TEST_F(LeftUnsettled, APassThatCouldNotReadTheQueueKeepsTheNote) {
    const Value note = Dictionary{{"people", Array{kPerson}}};
    world.preferences.set(kDaemonDomain, kCXDUnderWay, note);
    world.cx->whenOpening = [] { throw CXException("TestException", "cannot be opened"); };
    pass({own(CXDUpdateRecord, "Q:CXPerson", nullptr),
          makeRecord(CXDChangeGroupName, nullptr, kGroup, {CXDSyncSourceCX, CXDSyncSourceVaultra, "bob"}, "Name")});
    EXPECT_EQ(world.stored(kCXDUnderWay), note);
}

} // namespace
} // namespace rolvane
