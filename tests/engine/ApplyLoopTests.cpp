#include "EngineWorld.h"

#include "Writes.h"
#include "engine/memory/EngineState.h"
#include "foundation/CXException.h"
#include "store/files/CXFileManager.h"
#include "support/CapturingLog.h"

#include <gtest/gtest.h>
#include <numeric>
#include <sqlite3.h>

namespace rolvane {
namespace {

using test::Ended;
using test::makeRecord;
using test::update;
using test::World;
using Strings = std::vector<std::string>;

[[noreturn]] void fail(const char* reason) {
    throw CXException("TestException", reason);
}

class Pass : public ::testing::Test {
protected:
    Pass() {
        world.start();
        world.distributed.clear();
    }
    void trickle(const CXDChangeRecords& records) { world.engine->applyChangeRecords(records); }
    bool trickleEnds(const CXDChangeRecords& records) {
        try {
            trickle(records);
        } catch (const Ended&) {
            return true;
        }
        return false;
    }
    World world;
};

TEST_F(Pass, AGatheringPassGoesFromTheStartedToTheStoppedNotification) {
    world.cx->whenGathering = [] { return CXDChangeRecords{update("P1")}; };
    world.engine->bringSourcesUpToDate();
    EXPECT_EQ(world.events.all(),
              (Strings{"phase 1", "CXDCX open", "CXDVaultra open", "CXDCX gather", "CXDVaultra gather", "phase 2",
                       "phase 3", "CXDCX close", "CXDVaultra close", "stop", "stop"}));
    ASSERT_FALSE(world.distributed.posted().empty());
    EXPECT_EQ(world.distributed.posted()[0].name, "CXDStartedSyncingNotification");
    EXPECT_FALSE(world.distributed.posted()[0].object);
    EXPECT_EQ(world.vaultra->applied(), Strings{"P1"});
    EXPECT_EQ(world.progress.will, 1);
    EXPECT_EQ(world.progress.did, 1);
}

TEST_F(Pass, TheStoreIsToldOnceWhenFewContactsAreLeftToReadAndNeverWhenThereWereNotMany) {
    struct Files : CXFileManager {
        std::optional<Dictionary> dictionaryAtURL(const Url&, int* code, bool) override {
            if (code) *code = 200;
            return Dictionary{{"First", "X"}};
        }
    } files;
    const auto told = [&](int contacts) {
        world.events.clear();
        size_t applied = 0, before = 0;
        world.cx->whenApplying = [&](const CXDChangeRecordPtr&, bool*) {
            ++applied;
            if (world.events.count("CXDVaultra will close") == 0) before = applied;
            return true;
        };
        world.vaultra->whenGathering = [&] {
            CXDChangeRecords all;
            for (int i = 0; i < contacts; ++i) {
                const std::string name = "P" + std::to_string(i) + ":CXSubscribedPerson";
                all.push_back(makeRecord(CXDUpdateRecord, name.c_str(), nullptr,
                                         {CXDSyncSourceVaultra, CXDSyncSourceCX, "bob"}, Dictionary()));
                all.back()->setDelayedPayloadURL(Url("http://store.example/bob/Contacts/" + name), &files);
            }
            return all;
        };
        world.engine->bringSourcesUpToDate();
        EXPECT_EQ(applied, static_cast<size_t>(contacts));
        return std::pair(world.events.count("CXDVaultra will close"), before);
    };
    EXPECT_EQ(told(60), std::pair(size_t{1}, size_t{9}));
    EXPECT_EQ(told(51), std::pair(size_t{1}, size_t{0}));
    EXPECT_EQ(told(50).first, 0u);
}

TEST_F(Pass, ATricklePassOpensTheConduitsItselfAndStopsOnce) {
    test::CapturingLog log;
    test::DebugLevel level(1);
    trickle({update("P1")});
    EXPECT_EQ(world.events.all(), (Strings{"phase 2", "CXDCX open", "CXDVaultra open", "phase 3", "CXDCX close",
                                           "CXDVaultra close", "stop"}));
    EXPECT_TRUE(log.has("TRICKLE"));
    for (const Notification& posted : world.distributed.posted())
        EXPECT_NE(posted.name, "CXDStartedSyncingNotification");
}

TEST_F(Pass, WithNothingToDoBumpsTheShareCountAndWritesTheConduitData) {
    const int64_t before = world.rolvane->shareCount();
    world.engine->conduitObjectForKey("CXDCX", "priorState").set("<self>", Dictionary{});
    trickle({});
    EXPECT_EQ(world.rolvane->shareCount(), before + 1);
    EXPECT_EQ(world.stored("CXDShareCount"), Value(before + 1));
    EXPECT_EQ(world.stored("CXDLastOstrelUser"), Value("ann"));
    EXPECT_TRUE(world.stored("CXDConduitData").dictionary().contains("CXDCX"));
    EXPECT_TRUE(world.pending().empty());
    const Preferences onDisk(world.preferences.path(), daemonMemory(world.rolvane->path()));
    EXPECT_EQ(onDisk.get(kDaemonDomain, "CXDShareCount"), Value(before + 1));
}

TEST_F(Pass, LogsTheMingledFlatPendingAndDeniedLists) {
    test::CapturingLog log;
    test::DebugLevel level(1);
    const auto record = update("P1", 2);
    trickle({record});
    const std::string shown = "(\n    " + record->description() + ",\n)";
    EXPECT_TRUE(log.has("Mingled: " + shown)) << log.text();
    EXPECT_TRUE(log.has("Flat: " + shown));
    EXPECT_TRUE(log.has("Pending: " + shown));
    EXPECT_TRUE(log.has("Denied:  (\n)"));
}

TEST_F(Pass, AppliesWhatWasCarriedOverAfterWhatIsNew) {
    world.engine->setPendingChanges({update("P1"), update("P2")});
    world.account.threads = 1;
    trickle({update("P3"), update("P1")});
    EXPECT_EQ(world.vaultra->applied(), (Strings{"P3", "P1", "P2"}));
    EXPECT_TRUE(world.pending().empty());
}

TEST_F(Pass, WhatWaitedAndIsGoneFromTheDatabaseIsWithdrawn) {
    for (const char* uid : {"Kept:CXPerson", "Copy:CXSubscribedPerson"})
        world.rolvane->addRecord(CXPerson::initWithUniqueId(UniqueId(uid)));
    world.rolvane->save();
    const auto waiting = [](int32_t type, const char* person, const char* group, const char* user = "<self>") {
        return makeRecord(type, person, group, {CXDSyncSourceCX, CXDSyncSourceVaultra, user});
    };
    world.engine->setPendingChanges({waiting(CXDUpdateRecord, "Kept:CXPerson", nullptr),
                                     waiting(CXDUpdateRecord, "Copy:CXPerson", nullptr),
                                     waiting(CXDUpdateRecord, "Gone:CXPerson", nullptr),
                                     waiting(CXDUpdateRecord, "Theirs:CXPerson", nullptr, "bob"),
                                     waiting(CXDCompositeGroupChange, nullptr, "Gone:CXGroup"),
                                     waiting(CXDCompositeGroupChange, nullptr, "AllCXGroup")});
    trickle({update("Fresh:CXPerson")});
    EXPECT_EQ(
        world.vaultra->appliedWithTypes(),
        (std::multiset<std::string>{"Kept:CXPerson 1", "Copy:CXPerson 1", "Gone:CXPerson 260", "Theirs:CXPerson 1",
                                    "Gone:CXGroup 261", "AllCXGroup 3", "Fresh:CXPerson 1"}));
}

TEST_F(Pass, ARemovalThatWaitedOfWhatIsInTheDatabaseAgainIsGivenUp) {
    for (const char* uid : {"Back:CXPerson", "Theirs:CXPerson", "Copy:CXSubscribedPerson"})
        world.rolvane->addRecord(CXPerson::initWithUniqueId(UniqueId(uid)));
    world.rolvane->addRecord(CXGroup::initWithUniqueId(UniqueId("Back:CXGroup")));
    world.rolvane->save();
    const auto own = [](int32_t type, const char* person, const char* group, const char* user = "<self>") {
        return makeRecord(type, person, group, {CXDSyncSourceCX, CXDSyncSourceVaultra, user});
    };
    world.engine->setPendingChanges(
        {own(CXDDeleteRecord, "Back:CXPerson", nullptr), own(CXDDeleteRecord, "Copy:CXPerson", nullptr),
         own(CXDDeleteRecord, "Gone:CXPerson", nullptr), own(CXDDeleteRecord, "Theirs:CXPerson", nullptr, "bob"),
         own(CXDDeleteGroup, nullptr, "Back:CXGroup"), own(CXDDeleteGroup, nullptr, "AllCXGroup")});
    trickle({own(CXDUpdateRecord, "Back:CXPerson", nullptr), own(CXDChangeGroupName, nullptr, "Back:CXGroup")});
    EXPECT_EQ(world.vaultra->appliedWithTypes(),
              (std::multiset<std::string>{"Back:CXPerson 1", "Copy:CXPerson 260", "Gone:CXPerson 260",
                                          "Theirs:CXPerson 260", "Back:CXGroup 4", "AllCXGroup 261"}));
}

TEST(SingleGroups, ThatAreWithdrawnLeaveTheStoreThoughTheyStayInTheDatabase) {
    World world(false);
    CXMutableMultiValue nothing, locations;
    locations.addValue("http://store.example/ann/Contacts", kCXPublishLabel);
    world.rolvane->allGroup()->setValue(nothing, kCXRemoteLocationProperty);
    for (const char* uid : {"Published:CXGroup", "Withdrawn:CXGroup"})
        world.rolvane->addRecord(CXGroup::initWithUniqueId(UniqueId(uid)));
    world.rolvane->recordForUniqueId(UniqueId("Published:CXGroup"))->setValue(locations, kCXRemoteLocationProperty);
    world.subscribe("published-groups");
    world.start();
    world.engine->setPendingChanges({makeRecord(CXDDeleteGroup, nullptr, "Published:CXGroup"),
                                     makeRecord(CXDDeleteGroup, nullptr, "Withdrawn:CXGroup")});
    world.vaultra->whenApplying = [](const CXDChangeRecordPtr&, bool*) { return true; };
    world.engine->applyChangeRecords({});
    EXPECT_EQ(world.vaultra->applied(), Strings{"Withdrawn:CXGroup"});
}

TEST_F(Pass, WhoWaitedToBeListedAndIsGoneFromTheDatabaseIsTakenOutAndRemoved) {
    const CXPersonRef kept = CXPerson::initWithUniqueId(UniqueId("Kept:CXPerson"));
    world.rolvane->addRecord(kept);
    world.rolvane->save();
    const Dictionary list{{"memberAdds", Array{"Kept:CXPerson", "Gone:CXPerson"}},
                          {"subgroupAdds", Array{"Gone:CXGroup"}}};
    world.engine->setPendingChanges({makeRecord(CXDCompositeGroupChange, nullptr, "AllCXGroup",
                                                {CXDSyncSourceCX, CXDSyncSourceVaultra, "<self>"}, list)});
    std::mutex lock;
    Dictionary written;
    world.vaultra->whenApplying = [&](const CXDChangeRecordPtr& r, bool*) {
        const std::lock_guard guard(lock);
        if (r->type() == CXDCompositeGroupChange) written = r->inMemoryPayload().deepMutableCopy().dictionary();
        return true;
    };
    trickle({update("Fresh:CXPerson")});
    EXPECT_EQ(world.vaultra->appliedWithTypes(), (std::multiset<std::string>{"AllCXGroup 3", "Gone:CXPerson 260",
                                                                             "Gone:CXGroup 261", "Fresh:CXPerson 1"}));
    EXPECT_TRUE(written["memberRemoves"].array().containsString("Gone:CXPerson"));
    EXPECT_TRUE(written["subgroupRemoves"].array().containsString("Gone:CXGroup"));
    EXPECT_FALSE(written["memberRemoves"].array().containsString("Kept:CXPerson"));
}

TEST_F(Pass, SortsByTypeAndKeepsTheOrderOfArrivalWithinOne) {
    world.account.threads = 1;
    trickle({makeRecord(CXDDeleteRecord, "P1", nullptr), update("P2"), update("P3")});
    EXPECT_EQ(world.vaultra->applied(), (Strings{"P2", "P3", "P1"}));
}

TEST_F(Pass, AppliesInOrderRecordsOnTheMainThreadContactDatabaseFirst) {
    Strings order;
    world.cx->whenApplying = [&](const CXDChangeRecordPtr& r, bool*) {
        order.push_back("CX " + r->person()->str());
        return true;
    };
    world.vaultra->whenApplying = [&](const CXDChangeRecordPtr& r, bool*) {
        order.push_back("Vaultra " + r->person()->str());
        return true;
    };
    trickle({update("P1", 5), update("P2", 5)});
    EXPECT_EQ(order, (Strings{"CX P1", "Vaultra P1", "CX P2", "Vaultra P2"}));
    EXPECT_TRUE(world.vaultra->appliedOnlyOn(std::this_thread::get_id()));
}

TEST_F(Pass, InOrderRecordsWaitUntilEveryIndependentOneHasBeenHandled) {
    std::atomic<int> independent{0};
    int seen = -1;
    world.vaultra->whenApplying = [&](const CXDChangeRecordPtr& r, bool*) {
        if (r->type() == CXDChangeGroupReadACL)
            seen = independent;
        else
            ++independent;
        return true;
    };
    CXDChangeRecords records{makeRecord(CXDChangeGroupReadACL, nullptr, "G1", {}, Dictionary{})};
    for (int i = 0; i < 20; ++i) records.push_back(update(("P" + std::to_string(i)).c_str()));
    trickle(records);
    EXPECT_EQ(seen, 20);
}

TEST_F(Pass, ARecordThatCouldNotBeAppliedKeepsItsBitForTheNextPass) {
    world.account.threads = 1;
    world.vaultra->whenApplying = [](const CXDChangeRecordPtr&, bool*) { return false; };
    trickle({update("P1", 5), update("P2", 4), update("P3", 2)});
    EXPECT_EQ(world.pending(), (Strings{"P2:4", "P3:2", "P1:4"}));
    world.vaultra->whenApplying = nullptr;
    trickle({});
    EXPECT_EQ(world.pending(), Strings{"P3:2"}) << "the local folder is never applied here and stays for ever";
    EXPECT_EQ(world.cx->applied(), Strings{"P1"}) << "what was applied to the contact database is not applied again";
}

TEST_F(Pass, FoldsWhatWasAppliedIntoTheStateOfBothSources) {
    trickle({makeRecord(CXDAddRecordToGroup, "P1:CXPerson", "G1:CXGroup")});
    for (const char* conduit : {"CXDCX", "CXDVaultra"})
        EXPECT_EQ(world.stored("CXDConduitData")
                      .dictionary()[conduit]
                      .dictionary()["priorState"]
                      .dictionary()["<self>"]
                      .dictionary()["G1:CXGroup"]
                      .dictionary()["memberUIDState"],
                  Value(Array{"P1:CXPerson"}))
            << conduit;
}

TEST_F(Pass, AStoreThatIsOffLineGathersNothingAndTheQueueStays) {
    world.offLine = true;
    world.vaultra->whenApplying = [](const CXDChangeRecordPtr&, bool*) { return false; };
    world.cx->whenGathering = [] { return CXDChangeRecords{update("P1")}; };
    world.engine->bringSourcesUpToDate();
    EXPECT_EQ(world.events.count("CXDVaultra gather"), 0u);
    EXPECT_EQ(world.pending(), Strings{"P1:4"});
}

TEST_F(Pass, SeesTheConduitDataThatIsStoredWhenItStarts) {
    world.engine->conduitObjectForKey("CXDCX", "priorState").set("bob", "in memory only");
    world.engine->bringSourcesUpToDate();
    EXPECT_FALSE(world.engine->conduitObjectForKey("CXDCX", "priorState").contains("bob"));
}

// -- failures

TEST_F(Pass, AnExceptionWhileGatheringIsLoggedAndWhatWasGatheredIsApplied) {
    test::CapturingLog log;
    world.cx->whenGathering = [&] {
        world.engine->lockURL(Url("http://store.example/ann/Contacts/G1"));
        return CXDChangeRecords{update("P1")};
    };
    world.vaultra->whenGathering = []() -> CXDChangeRecords { fail("no listing"); };
    world.engine->bringSourcesUpToDate();
    EXPECT_TRUE(log.has("bringSourcesUpToDate: Caught TestException: no listing")) << log.text();
    EXPECT_EQ(world.vaultra->applied(), Strings{"P1"});
    EXPECT_EQ(world.events.count("unlock"), 1u);
}

TEST_F(Pass, AnotherObjectThrownWhileGatheringPasses) {
    world.cx->whenGathering = []() -> CXDChangeRecords { throw 42; };
    EXPECT_THROW(world.engine->bringSourcesUpToDate(), int);
    EXPECT_FALSE(world.engine->passRunning());
}

TEST_F(Pass, AnExceptionBeforeTheQueueWasReadLosesNeitherNewNorOldChanges) {
    test::CapturingLog log;
    world.engine->setPendingChanges({update("P1")});
    world.vaultra->whenOpening = [] { fail("no network"); };
    trickle({update("P2")});
    EXPECT_TRUE(log.has("applyChangeRecords: Caught TestException: no network")) << log.text();
    EXPECT_EQ(world.pending(), (Strings{"P2:4", "P1:4"}));
    EXPECT_EQ(world.events.count("CXDVaultra close"), 1u) << "the clean-up runs";
}

TEST_F(Pass, AnExceptionInTheMiddleKeepsWhatNobodyCameTo) {
    world.vaultra->whenLocating = [n = 0]() mutable {
        if (++n == 2) fail("damaged location"); // outside of the conduit's own guard
    };
    trickle({update("P1", 5), update("P2", 5), update("P3", 5)});
    EXPECT_EQ(world.vaultra->applied(), Strings{"P1"});
    EXPECT_EQ(world.pending(), (Strings{"P2:5", "P3:5"}));
}

TEST_F(Pass, ALockIsReleasedWhateverHappens) {
    world.vaultra->whenApplying = [&](const CXDChangeRecordPtr&, bool*) -> bool {
        world.engine->lockURL(Url("http://store.example/ann/Contacts/G1"));
        fail("refused");
    };
    test::CapturingLog log;
    trickle({update("P1")});
    EXPECT_TRUE(log.has("Exception with applying change record: refused"));
    EXPECT_EQ(world.events.count("lock"), 1u);
    EXPECT_EQ(world.events.count("unlock"), 1u);
    EXPECT_EQ(world.pending(), Strings{"P1:4"});
}

TEST_F(Pass, AnotherObjectThrownWhileApplyingPassesAfterTheCleanUp) {
    world.vaultra->whenApplying = [&](const CXDChangeRecordPtr&, bool*) -> bool {
        world.engine->lockURL(Url("http://store.example/ann/Contacts/G1"));
        throw 42;
    };
    EXPECT_THROW(trickle({update("P1", 5)}), int);
    EXPECT_EQ(world.events.count("unlock"), 1u);
    EXPECT_FALSE(world.engine->passRunning());
}

TEST_F(Pass, AnExceptionWhileClosingIsLoggedAndThePassEndsInOrder) {
    test::CapturingLog log;
    world.cx->whenClosing = [] { fail("disk full"); };
    trickle({update("P1")});
    EXPECT_TRUE(log.has("applyChangeRecords close: Caught TestException: disk full"));
    EXPECT_EQ(world.events.all().back(), "stop");
    EXPECT_EQ(world.stored("CXDShareCount"), Value(world.rolvane->shareCount()));
}

TEST_F(Pass, AFullDiskLeavesTheChangesWithWhoeverDeliveredThem) {
    trickle({});
    world.engine->setPendingChanges({update("P1", 2)});
    test::CapturingLog log;
    world.vaultra->whenApplying = [](const CXDChangeRecordPtr&, bool*) {
        test::interceptWrites([] { return false; });
        return false;
    };
    EXPECT_THROW(trickle({update("P2")}), CXException);
    test::interceptWrites(nullptr);
    EXPECT_TRUE(log.mentions("applyChangeRecords close: Caught CXDatabaseException: ")) << log.text();
    EXPECT_EQ(world.events.all().back(), "stop") << "the pass goes to its end all the same";
    Preferences onDisk(world.preferences.path(), daemonMemory(world.rolvane->path()));
    EXPECT_EQ(EngineState(onDisk).getPendingChanges().size(), 1u);
    EXPECT_EQ(onDisk.get(kDaemonDomain, "CXDShareCount").integer(), world.rolvane->shareCount());

    world.vaultra->whenApplying = nullptr;
    trickle({update("P2")});
    EXPECT_EQ(world.pending(), Strings{"P1:2"});
}

TEST_F(Pass, ARefusalInAPassThatCouldNotBeStoredDoesNotReachIntoTheNext) {
    trickle({});
    world.vaultra->whenApplying = [](const CXDChangeRecordPtr&, bool* denied) {
        test::interceptWrites([] { return false; });
        *denied = true;
        return false;
    };
    test::CapturingLog log;
    EXPECT_THROW(trickle({update("P1", 4, "bob"), update("P2", CXDSyncSourceLocal)}), CXException);
    test::interceptWrites(nullptr);

    world.vaultra->whenApplying = nullptr; // granted meanwhile
    trickle({update("P1", 4, "bob"), update("P2", CXDSyncSourceLocal)});
    EXPECT_EQ(world.vaultra->applied(), (Strings{"P1", "P1"})) << "delivered again, it was taken for refused";
    EXPECT_EQ(world.pending(), Strings{"P2:2"});
}

TEST_F(Pass, WhatTheContactDatabaseCouldNotSaveIsNotWrittenDownAsApplied) {
    trickle({});
    const auto known = [&] {
        const Value state = world.stored("CXDConduitData").dictionary()["CXDCX"].dictionary()["priorState"];
        return state.dictionary()["<self>"].dictionary().contains("G1:CXGroup");
    };
    world.cx->whenApplying = [&](const CXDChangeRecordPtr&, bool*) {
        world.rolvane->addRecord(CXPerson::create());
        test::interceptWrites([] { return false; });
        return true;
    };
    const auto membership = makeRecord(CXDAddRecordToGroup, "P1:CXPerson", "G1:CXGroup", {4, 1, "<self>"});
    test::CapturingLog log;
    EXPECT_THROW(trickle({membership}), CXException);
    test::interceptWrites(nullptr);
    EXPECT_FALSE(world.rolvane->hasUnsavedChanges()) << "the pass has not been, and its changes come again";
    EXPECT_FALSE(known()) << "the next comparison would take the missing member for one that the user removed";
    EXPECT_FALSE(world.engine->conduitObjectForKey("CXDCX", "priorState").contains("<self>"));

    world.cx->whenApplying = nullptr;
    trickle({membership});
    EXPECT_FALSE(world.rolvane->hasUnsavedChanges());
    EXPECT_TRUE(known());
}

TEST_F(Pass, AnOutcomeThatCannotBeStoredTakesNothingBack) {
    trickle({});
    sqlite3* file = nullptr;
    ASSERT_EQ(sqlite3_open(world.preferences.path().c_str(), &file), SQLITE_OK);
    ASSERT_EQ(sqlite3_exec(file,
                           "CREATE TRIGGER refusal BEFORE INSERT ON preferences BEGIN SELECT RAISE(ABORT, 'no'); END",
                           nullptr, nullptr, nullptr),
              SQLITE_OK);
    sqlite3_close(file);
    const test::CapturingLog log;
    EXPECT_NO_THROW(trickle({update("P1", 2)})) << "the changes are stored, and need not be delivered again";
    EXPECT_EQ(world.pending(), Strings{"P1:2"});
    EXPECT_EQ(world.stored("CXDShareCount").integer(), world.rolvane->shareCount());
    EXPECT_TRUE(log.mentions("The outcome of the pass could not be stored")) << log.text();
}

// -- denials

TEST_F(Pass, ADeniedChangeIsDroppedCancelsItsUsersOthersAndIsRetriedOnce) {
    world.vaultra->whenApplying = [](const CXDChangeRecordPtr&, bool* denied) {
        *denied = true;
        return false;
    };
    trickle({update("P1", 5, "bob"), update("P2", 5, "bob")});
    EXPECT_EQ(world.vaultra->applied(), Strings{"P1"}) << "the second counts as done without being applied";
    EXPECT_TRUE(world.pending().empty());
    EXPECT_EQ(world.events.count("CXDCX gather"), 0u) << "never nested";
    world.cx->whenGathering = [] { return CXDChangeRecords{update("P3", 4, "bob")}; };
    world.turn();
    EXPECT_EQ(world.events.count("CXDCX gather"), 1u);
    EXPECT_EQ(world.vaultra->applied(), (Strings{"P1", "P3"})) << "the denied set starts empty again";
    world.turn();
    EXPECT_EQ(world.events.count("CXDCX gather"), 1u) << "a retry schedules no other";
}

TEST_F(Pass, ADenialStandsUntilASourceSaysOtherwise) {
    world.vaultra->whenApplying = [](const CXDChangeRecordPtr& record, bool* denied) {
        if (record->user() == UserName("bob")) *denied = true;
        return record->user() != UserName("bob");
    };
    trickle({update("B1", 5, "bob"), update("C1", 5, "carol"), update("C2", 5, "carol")});
    EXPECT_EQ(world.vaultra->applied(), (Strings{"B1", "C1"})) << "the flag still stood when the third one's turn came";
}

TEST_F(Pass, AGroupOfWhichAChangeGotLostInAFoldIsComparedOnceMore) {
    const Dictionary writer{{"additions", Array{"bob"}}, {"deletions", Array()}};
    trickle({makeRecord(CXDChangeGroupReadWriteACL, nullptr, "G1", {}, writer),
             makeRecord(CXDAddRecordToGroup, "P1", "G1"), makeRecord(CXDAddRecordToGroup, "P1", "G2")});
    const Dictionary unsettled = world.engine->conduitObjectForKey("CXDCX", "unsettledGroups");
    EXPECT_EQ(unsettled.allKeys(), Strings{"G1"});
    world.turn();
    EXPECT_EQ(world.events.count("CXDCX gather"), 1U);
}

TEST_F(Pass, WithoutRetryTheDeniedSetIsEmptiedAllTheSame) {
    world.vaultra->whenApplying = [](const CXDChangeRecordPtr&, bool* denied) {
        *denied = true;
        return false;
    };
    const auto record = update("P1", 4, "bob");
    world.engine->applyChangeRecords({record}, true, false);
    EXPECT_FALSE(world.engine->shouldChangeRecordBeCanceled(*record));
    EXPECT_TRUE(world.pending().empty());
    world.turn();
    EXPECT_EQ(world.events.count("CXDCX gather"), 0u);
}

TEST_F(Pass, ARevokedLocationsRecordCountsAsDoneAndTheListIsEmptyAfterwards) {
    world.cx->whenApplying = [&](const CXDChangeRecordPtr&, bool*) {
        world.engine->revokeRemoteLocation(RemoteLocation("http://store.example/bob/Contacts"), std::nullopt);
        return true;
    };
    trickle({update("P1", 5, "eve"), update("P2", 5, "bob")});
    EXPECT_EQ(world.vaultra->applied(), Strings{"P1"});
    EXPECT_TRUE(world.pending().empty());
    EXPECT_TRUE(world.engine->revokedRemoteLocations().empty());
}

// -- passes among one another

TEST_F(Pass, APassAskedForInsideAnotherRunsWhenTheEventIsOver) {
    world.cx->whenGathering = [&, n = 0]() mutable {
        if (n++ == 0) {
            world.engine->bringSourcesUpToDate();
            world.engine->applyChangeRecords({update("P7")});
        }
        return CXDChangeRecords{};
    };
    world.engine->bringSourcesUpToDate();
    EXPECT_EQ(world.events.count("CXDCX gather"), 1u);
    world.turn();
    EXPECT_EQ(world.events.count("CXDCX gather"), 2u);
    EXPECT_EQ(world.vaultra->applied(), Strings{"P7"});
}

TEST_F(Pass, ASyncedNotificationOfTheLoginUserStartsNone) {
    world.engine->cxdSynced({"CXDSynced", "annlogin", {}});
    EXPECT_EQ(world.events.count("CXDCX gather"), 0u);
    world.engine->cxdSynced({"CXDSynced", "bob", {}});
    world.engine->cxdSynced({"CXDSynced", std::nullopt, {}});
    world.engine->cxdPublishedAll({"CXDPublishedAll", std::nullopt, {}});
    EXPECT_EQ(world.events.count("CXDCX gather"), 3u);
}

// -- ending

TEST_F(Pass, WithAnIntervalOfZeroTheProcessEndsAtTheNextTurn) {
    world.idleExit.setInterval(0);
    trickle({update("P1")});
    EXPECT_THROW(world.turn(), Ended);
}

TEST_F(Pass, ARetryThatWaitsRunsBeforeTheIdleExit) {
    world.idleExit.setInterval(0);
    world.vaultra->whenApplying = [](const CXDChangeRecordPtr&, bool* denied) {
        *denied = true;
        return false;
    };
    trickle({update("P1", 4, "bob")});
    EXPECT_THROW(for (int i = 0; i < 10; ++i) world.turn(), Ended);
    EXPECT_EQ(world.events.count("CXDCX gather"), 1u);
}

TEST_F(Pass, WhatAnotherProcessSavedMeanwhileIsDeliveredBeforeTheIdleExit) {
    world.idleExit.setInterval(0);
    world.rolvane->cursorPosition(); // watching from here on
    int delivered = 0;
    const auto observation =
        world.center.observe(kCXDatabaseChangedExternallyNotificationPriv, [&](const Notification&) {
            ++delivered;
            world.engine->applyChangeRecords({update("P1")});
        });
    world.engine->applyChangeRecords(CXDChangeRecords{});
    const auto application = world.application();
    application->addRecord(CXPerson::create());
    application->save();
    EXPECT_THROW(for (int i = 0; i < 10; ++i) world.turn(), Ended);
    EXPECT_EQ(delivered, 1);
    EXPECT_EQ(world.vaultra->applied(), Strings{"P1"});
}

TEST_F(Pass, ARequestToEndKeepsWhatIsLeftAndEndsTheProcess) {
    world.account.threads = 1;
    world.vaultra->whenApplying = [&](const CXDChangeRecordPtr&, bool*) {
        world.engine->requestTermination();
        return true;
    };
    EXPECT_TRUE(trickleEnds({update("P1"), update("P2"), update("P3", 5)}));
    EXPECT_EQ(world.vaultra->applied(), Strings{"P1"});
    EXPECT_EQ(world.pending(), (Strings{"P2:4", "P3:5"}));
    EXPECT_EQ(world.stored("CXDShareCount"), Value(world.rolvane->shareCount()));
}

TEST_F(Pass, ARequestToEndWhileGatheringEndsBeforeAnythingIsChanged) {
    world.cx->whenGathering = [&] {
        world.engine->requestTermination();
        return CXDChangeRecords{update("P1")};
    };
    EXPECT_THROW(world.engine->bringSourcesUpToDate(), Ended);
    EXPECT_TRUE(world.vaultra->applied().empty());
    EXPECT_EQ(world.events.count("CXDCX close"), 0u) << "the last-sync date stays where it was";
}

} // namespace
} // namespace rolvane
