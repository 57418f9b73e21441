#include "EngineWorld.h"

#include "engine/memory/EngineState.h"
#include "foundation/KeyedArchive.h"
#include "support/CapturingLog.h"

#include <gtest/gtest.h>
#include <sqlite3.h>

namespace rolvane {
namespace {

using test::Ended;
using test::update;
using test::World;

bool ends(const std::function<void()>& action) {
    try {
        action();
    } catch (const Ended& ended) {
        EXPECT_EQ(ended.status, 0);
        return true;
    }
    return false;
}

TEST(EngineMemory, AskingAnEmptyStoreMakesBothLevelsAndAWriteKeepsThem) {
    World world;
    world.start();
    Dictionary made = world.engine->conduitObjectForKey("CXDLocal", "priorState");
    EXPECT_TRUE(made.empty());
    made.set("ann", Dictionary{});
    world.engine->syncPrefs();
    EXPECT_EQ(world.stored("CXDConduitData").dictionary()["CXDLocal"],
              Value(Dictionary{{"priorState", Dictionary{{"ann", Dictionary{}}}}}));
}

TEST(EngineMemory, SettingAnObjectMakesTheConduitsDictionary) {
    World world;
    world.start();
    world.engine->setConduitObjectForKey("CXDLocal", Dictionary{{"a", 1}}, "state");
    EXPECT_EQ(world.engine->conduitObjectForKey("CXDLocal", "state"), (Dictionary{{"a", 1}}));
}

TEST(EngineMemory, WhatIsReadIsACopyThatCanBeChangedWithoutAnyWrite) {
    World world;
    world.preferences.set(kDaemonDomain, "CXDConduitData", Dictionary{{"CXDLocal", Dictionary{}}});
    world.preferences.synchronize(kDaemonDomain);
    EngineState state(world.preferences);
    state.conduitObjectForKey("CXDLocal", "priorState").set("ann", 1);
    EXPECT_EQ(world.stored("CXDConduitData"), Value(Dictionary{{"CXDLocal", Dictionary{}}}));
    state.dropConduitData();
    EXPECT_TRUE(state.conduitObjectForKey("CXDLocal", "priorState").empty());
}

TEST(EngineMemory, AMappingWithOneOfItsTwoEndsMissingChangesNothing) {
    World world;
    world.start();
    world.engine->setRemoteLocationForSubscriptionUID(std::nullopt, UniqueId("S1"));
    world.engine->setRemoteLocationForSubscriptionUID(RemoteLocation("http://x/bob/Contacts"), std::nullopt);
    EXPECT_FALSE(world.engine->conduitData().contains("subscriptionMap"));
}

TEST(EngineMemory, TwoSubscriptionsToOneLocationAreForgottenTogether) {
    World world;
    world.start();
    const RemoteLocation bob("http://x/bob/Contacts"), eve("http://x/eve/Contacts");
    for (const char* uid : {"S1", "S2"}) world.engine->setRemoteLocationForSubscriptionUID(bob, UniqueId(uid));
    world.engine->setRemoteLocationForSubscriptionUID(eve, UniqueId("S3"));
    world.engine->removeSubscriptionMapForRemoteLocation(bob);
    EXPECT_EQ(world.engine->remoteLocationForSubscriptionUID(UniqueId("S1")), std::nullopt);
    EXPECT_EQ(world.engine->remoteLocationForSubscriptionUID(UniqueId("S2")), std::nullopt);
    EXPECT_EQ(world.engine->remoteLocationForSubscriptionUID(UniqueId("S3")), eve);
}

TEST(EngineMemory, TheQueueComesBackAsItWasStored) {
    World world;
    EngineState state(world.preferences);
    EXPECT_TRUE(state.getPendingChanges().empty());
    state.setPendingChanges({update("P1"), update("P2", 5, "bob")});
    const CXDChangeRecords back = EngineState(world.preferences).getPendingChanges();
    ASSERT_EQ(back.size(), 2u);
    EXPECT_TRUE(back[1]->isEqual(*update("P2", 5, "bob")));
    EXPECT_EQ(back[0]->payload(), Value(Dictionary{{"First", "P1"}}));
}

TEST(EngineMemory, AQueueThatCannotBeReadIsEmptyAndNothingIsLogged) {
    World world;
    test::CapturingLog log;
    test::DebugLevel level(1);
    EngineState state(world.preferences);
    for (const Value& damaged : {Value("text"), Value(Bytes{1, 2, 3}), Value(5)}) {
        world.preferences.set(kDaemonDomain, "CXDPendingChanges", damaged);
        EXPECT_TRUE(state.getPendingChanges().empty());
    }
    world.preferences.synchronize(kDaemonDomain);
    sqlite3* file = nullptr;
    ASSERT_EQ(sqlite3_open(world.rolvane->path().c_str(), &file), SQLITE_OK);
    EXPECT_EQ(sqlite3_exec(file, "UPDATE daemon SET value = x'ffff' WHERE key = 'CXDPendingChanges'", nullptr, nullptr,
                           nullptr),
              SQLITE_OK);
    EXPECT_EQ(sqlite3_changes(file), 1);
    sqlite3_close(file);
    EXPECT_TRUE(state.getPendingChanges().empty()) << "bytes that are no value at all";
    EXPECT_TRUE(log.lines().empty()) << log.text();
}

TEST(EngineMemory, AQueueWithADamagedRecordIsNotReturnedInPart) {
    World world;
    EngineState state(world.preferences);
    state.setPendingChanges({update("P1"), update("P2")});
    const Bytes sound = world.stored("CXDPendingChanges").data();
    ASSERT_EQ(state.getPendingChanges().size(), 2u);

    Bytes followed = sound;
    followed.push_back(0);
    Bytes cut(sound.begin(), sound.end() - 1);
    const Bytes nameless = KeyedArchive::archive({{"CXDChangeRecord", {}}, {"", {}}});
    Bytes keyless = nameless; // its last two bytes are the empty dictionary of keys
    keyless[keyless.size() - 2] = 0x7f;
    for (const Bytes& damaged : {followed, cut, keyless}) {
        world.preferences.set(kDaemonDomain, "CXDPendingChanges", Value(damaged));
        EXPECT_TRUE(state.getPendingChanges().empty()) << "the first one was sound";
    }
}

TEST(EngineMemory, AResetForgetsEverythingButTheDebugLevel) {
    World world;
    world.start();
    for (const char* key :
         {"CXDPendingChanges", "CXDConduitData", "CXDVaultraConduitLastSyncDate", "CXDCXConduitLastSyncDate",
          "CXDLocalConduitLastSyncDate", "CXDShareCount", "CXDLastOstrelUser", "CXDDebugLevel"})
        world.preferences.set(kDaemonDomain, key, 1);
    world.preferences.synchronize(kDaemonDomain);
    world.engine->conduitObjectForKey("CXDLocal", "priorState").set("ann", 1);
    test::CapturingLog log;
    test::DebugLevel level(1);
    world.engine->reset();
    EXPECT_EQ(log.lines(), std::vector<std::string>{"Reset!"});
    EXPECT_EQ(Preferences(world.preferences.path()).keys(kDaemonDomain), std::vector<std::string>{"CXDDebugLevel"});
    EXPECT_TRUE(world.engine->conduitData().empty());
}

TEST(EngineMemory, AResetKeepsWhatTheAccessListsWaitFor) {
    World world;
    world.start();
    world.preferences.set(kDaemonDomain, kCXDUnsavedAccessLists, Dictionary{{"https://store/ann/", Array{}}});
    world.engine->reset();
    EXPECT_TRUE(world.stored(kCXDUnsavedAccessLists));
}

class ShareCount : public ::testing::Test {
protected:
    ShareCount() { world.start(); }
    // True when the check threw the memory away.
    bool resets(const Value& count, const Value& user) {
        world.preferences.set(kDaemonDomain, "CXDShareCount", count);
        world.preferences.set(kDaemonDomain, "CXDLastOstrelUser", user);
        world.preferences.set(kDaemonDomain, "CXDCXConduitLastSyncDate", Date(5));
        world.preferences.synchronize(kDaemonDomain);
        world.engine->checkCXShareCount();
        return !world.stored("CXDCXConduitLastSyncDate");
    }
    World world;
};

TEST_F(ShareCount, OfTheSameDatabaseAndAccountKeepsTheMemory) {
    EXPECT_FALSE(resets(world.rolvane->shareCount(), "ann"));
}

TEST_F(ShareCount, OfAnotherDatabaseThrowsTheMemoryAway) {
    EXPECT_TRUE(resets(world.rolvane->shareCount() + 1, "ann"));
}

TEST_F(ShareCount, OfAnotherAccountOrNoneThrowsTheMemoryAway) {
    EXPECT_TRUE(resets(world.rolvane->shareCount(), "bob"));
    EXPECT_TRUE(resets(world.rolvane->shareCount(), {}));
    world.account.user = std::nullopt;
    EXPECT_TRUE(resets(world.rolvane->shareCount(), "ann"));
}

TEST_F(ShareCount, ThatIsMissingIsAFirstSync) {
    test::CapturingLog log;
    test::DebugLevel level(1);
    EXPECT_TRUE(resets({}, {}));
    EXPECT_EQ(log.lines(), (std::vector<std::string>{"First Sync", "Reset!"}));
    EXPECT_FALSE(resets({}, "ann")) << "only the account decides then";
}

TEST(EngineStart, RegistersUpdatesTheConfigurationAndObserves) {
    World world;
    world.start();
    EXPECT_TRUE(world.account.failedPassword);
    EXPECT_EQ(world.account.updates, 1);
    for (const char* name : {"CXSubscriptionListChanged", "CXAllACLChanged"}) {
        world.events.clear();
        world.distributed.post({name, std::nullopt, {}});
        EXPECT_EQ(world.events.count("CXDCX gather"), 1u) << name;
    }
}

TEST(EngineStart, EndsWithoutAnAccountOrPublicationAndTheLocalSubscriptionAlone) {
    World world(false);
    world.account.user = std::nullopt;
    EXPECT_TRUE(ends([&] { world.start(); }));
}

TEST(EngineStart, EndsWithNothingPublishedAndFewerThanTwoSubscriptions) {
    World world(false);
    EXPECT_TRUE(ends([&] { world.start(); })) << "the built-in subscription alone";
    world.subscribe("http://store.example/bob/Contacts");
    EXPECT_FALSE(ends([&] { world.start(); })) << "the built-in one and another";
}

TEST(EngineStart, APublisherIsAlwaysServed) {
    World world;
    EXPECT_FALSE(ends([&] { world.start(); }));
    EXPECT_FALSE(ends([&] { world.engine->updateStateAndExitIfNeeded(); }));
}

TEST(EngineStart, LosingTheAccountRemovesRemoteSubscriptionsAndThePublication) {
    World world;
    world.subscribe("http://store.example/bob/Contacts");
    world.start();
    world.account.user = UserName("");
    EXPECT_TRUE(ends([&] { world.engine->updateStateAndExitIfNeeded(); }));
    ASSERT_EQ(world.rolvane->subscriptions().size(), 1u);
    EXPECT_TRUE(world.rolvane->subscriptions()[0]->isLocal());
    EXPECT_FALSE(world.rolvane->allGroup()->valueForProperty(kCXRemoteLocationProperty));
    EXPECT_FALSE(world.rolvane->hasUnsavedChanges());
}

TEST(EngineStart, WhoPublishesNothingHasNoPriorStateOfHisOwn) {
    World world(false);
    world.subscribe("http://store.example/bob/Contacts");
    const Dictionary users{{"<self>", Dictionary{}}, {"bob", Dictionary{}}};
    const Dictionary data{{"CXDCX", Dictionary{{"priorState", users.mutableCopy()}}},
                          {"CXDVaultra", Dictionary{{"priorState", users.mutableCopy()}}}};
    world.preferences.set(kDaemonDomain, "CXDConduitData", data);
    world.preferences.synchronize(kDaemonDomain);
    world.start();
    const Dictionary kept{{"priorState", Dictionary{{"bob", Dictionary{}}}}};
    EXPECT_EQ(world.stored("CXDConduitData"), Value(Dictionary{{"CXDCX", kept}, {"CXDVaultra", kept}}));
}

TEST(EngineStart, AUserWithoutASubscriptionIsForgottenInBothConduits) {
    World world;
    world.subscribe("http://store.example/bob/Contacts");
    world.start();
    for (const char* conduit : {"CXDCX", "CXDVaultra"})
        for (const char* user : {"<self>", "bob", "eve"})
            world.engine->conduitObjectForKey(conduit, "priorState").set(user, Dictionary{});
    world.engine->setRemoteLocationForSubscriptionUID(RemoteLocation("http://store.example/eve/Contacts"),
                                                      UniqueId("S1"));
    test::CapturingLog log;
    test::DebugLevel level(1);
    world.engine->removeCacheDataForConduit(*world.vaultra);
    EXPECT_EQ(log.lines(), std::vector<std::string>{"Removing truth data for eve (CXDVaultra)"});
    for (const char* conduit : {"CXDCX", "CXDVaultra"})
        EXPECT_EQ(
            world.stored("CXDConduitData").dictionary()[conduit].dictionary()["priorState"].dictionary().allKeys(),
            (std::vector<std::string>{"<self>", "bob"}));
    EXPECT_EQ(world.engine->remoteLocationForSubscriptionUID(UniqueId("S1")), std::nullopt);
}

TEST(EngineEnd, StopsProgressAndLeavesALine) {
    World world;
    world.start();
    test::CapturingLog log;
    test::DebugLevel level(1);
    EXPECT_TRUE(ends([&] { world.engine->killCXD(); }));
    EXPECT_EQ(world.events.all(), std::vector<std::string>{"stop"});
    EXPECT_TRUE(log.has("Killing RolvaneManager"));
}

TEST(EngineEnd, ProgressStopsThenTheLoopTurnsOnceThenTheLineIsLogged) {
    World world;
    world.start();
    test::CapturingLog log;
    test::DebugLevel level(1);
    std::vector<std::string> seen;
    world.loop.performAfterDelay(0, [&] {
        seen = world.events.all();
        seen.push_back(log.has("Killing RolvaneManager") ? "too late" : "turn");
        world.loop.performAfterDelay(0, [&] { seen.push_back("another turn"); });
    });
    EXPECT_TRUE(ends([&] { world.engine->killCXD(); }));
    EXPECT_EQ(seen, (std::vector<std::string>{"stop", "turn"}));
}

TEST(EngineEnd, WhatIsDeliveredMeanwhileWaitsInTheDatabaseForTheNextProcess) {
    World world;
    world.start();
    world.rolvane->cursorPosition(); // watching from here on
    const auto observation =
        world.center.observe(kCXDatabaseChangedExternallyNotificationPriv,
                             [&](const Notification&) { world.engine->applyChangeRecords({update("P1")}); });
    const auto application = world.application();
    application->addRecord(CXPerson::create());
    application->save();
    world.loop.performAfterDelay(0, [&] { world.rolvane->deliverExternalChanges(); });
    const test::CapturingLog log;
    EXPECT_TRUE(ends([&] { world.engine->killCXD(); }));
    EXPECT_TRUE(world.vaultra->applied().empty());
    EXPECT_TRUE(world.rolvane->hasExternalChanges());
}

TEST(EngineEnd, AFailedPasswordEndsTheProcess) {
    World world;
    world.start();
    EXPECT_TRUE(ends([&] { world.account.failedPassword(); }));
    EXPECT_EQ(world.events.count("stop"), 2u);
}

TEST(EngineEnd, IsReachedForALocationThatNoConduitServes) {
    World world;
    world.start();
    EXPECT_EQ(world.engine->userForRemoteLocation(RemoteLocation("http://x/ANN/Contacts")), kSelf);
    EXPECT_EQ(world.engine->userForRemoteLocation(RemoteLocation("file:/usr/share/rolvane/annlogin")), kSelf);
    EXPECT_TRUE(ends([&] { world.engine->userForRemoteLocation(RemoteLocation("https://x/ann/Contacts")); }));
}

TEST(IdleExitTimer, WithoutAnIntervalATimerThatRunsIsLeftAlone) {
    RunLoop loop;
    IdleExit idle;
    int fired = 0;
    idle.arm(loop, [&] { ++fired; });
    loop.runOnce(0);
    EXPECT_EQ(fired, 0);
    idle.setInterval(0);
    idle.arm(loop, [&] { ++fired; });
    idle.setInterval(IdleExit::kNever);
    idle.arm(loop, [&] { fired += 10; });
    loop.runOnce(0);
    EXPECT_EQ(fired, 1);
}

TEST(IdleExitTimer, EveryArmingStartsTheCountdownAnew) {
    RunLoop loop;
    IdleExit idle;
    idle.setInterval(0);
    int fired = 0;
    idle.arm(loop, [&] { fired += 10; });
    idle.arm(loop, [&] { ++fired; });
    loop.runOnce(0);
    EXPECT_EQ(fired, 1);
}

TEST(SharedEngine, IsMadeOnFirstUseOnly) {
    World world;
    int made = 0;
    CXDSyncEngine::setMaker([&] {
        ++made;
        return std::make_unique<CXDSyncEngine>(world.collaborators());
    });
    IdleExit::process().setInterval(IdleExit::kNever);
    CXDSyncEngine::persist();
    EXPECT_EQ(made, 0) << "with no interval nothing is armed and no engine is made";
    CXDSyncEngine& engine = CXDSyncEngine::sharedSyncEngine();
    EXPECT_EQ(&engine, &CXDSyncEngine::sharedSyncEngine());
    EXPECT_EQ(CXDSyncEngine::sharedSyncEngineIfMade(), &engine);
    EXPECT_EQ(made, 1);
    CXDSyncEngine::setMaker({});
    EXPECT_THROW(CXDSyncEngine::sharedSyncEngine(), CXException);
}

TEST(SharedEngine, KnowsItsExecutable) {
    EXPECT_TRUE(CXDSyncEngine::cxdPath().ends_with("/test_engine")) << CXDSyncEngine::cxdPath();
}

TEST(Conduits, AreKnownByOneSourceBitEach) {
    World world;
    world.start();
    EXPECT_EQ(world.engine->conduitForSyncSource(1), world.cx);
    EXPECT_EQ(world.engine->conduitForSyncSource(4), world.vaultra);
    for (const int32_t source : {0, 2, 5, 8, 16}) EXPECT_EQ(world.engine->conduitForSyncSource(source), nullptr);
}

TEST(Conduits, ARecordsLocationIsThatOfItsRealUser) {
    World world;
    world.start();
    EXPECT_EQ(update("P1")->remoteLocation(*world.engine), RemoteLocation("http://store.example/ann/Contacts"));
    EXPECT_EQ(update("P1", 5)->remoteLocation(*world.engine), std::nullopt);
}

class Revoking : public ::testing::Test {
protected:
    Revoking() { world.start(); }
    World world;
    const RemoteLocation bob{"http://store.example/bob/Contacts"};
};

TEST_F(Revoking, ForgetsTheUserInBothConduitsAndTheSubscription) {
    for (const char* conduit : {"CXDCX", "CXDVaultra"})
        for (const char* user : {"bob", "eve"})
            world.engine->conduitObjectForKey(conduit, "priorState").set(user, Dictionary{});
    world.engine->setRemoteLocationForSubscriptionUID(bob, UniqueId("S1"));
    world.engine->revokeRemoteLocation(bob, UniqueId("S1"));
    for (const char* conduit : {"CXDCX", "CXDVaultra"})
        EXPECT_EQ(world.engine->conduitObjectForKey(conduit, "priorState").allKeys(), std::vector<std::string>{"eve"});
    EXPECT_EQ(world.engine->remoteLocationForSubscriptionUID(UniqueId("S1")), std::nullopt);
    EXPECT_TRUE(world.engine->isRevoked(bob));
    EXPECT_EQ(world.engine->revokedRemoteLocations(), std::vector<RemoteLocation>{bob});
}

TEST_F(Revoking, DropsTheUsersQueuedChanges) {
    world.engine->setPendingChanges({update("P1", 4, "bob"), update("P2", 4, "eve"), update("P3", 4, "bob")});
    world.engine->revokeRemoteLocation(bob, std::nullopt);
    EXPECT_EQ(world.pending(), std::vector<std::string>{"P2:4"});
}

TEST_F(Revoking, WithoutQueuedChangesOfTheUserTheQueueIsNotTouched) {
    world.preferences.set(kDaemonDomain, "CXDPendingChanges", "not even readable");
    world.preferences.synchronize(kDaemonDomain);
    world.engine->revokeRemoteLocation(bob, std::nullopt);
    EXPECT_EQ(world.stored("CXDPendingChanges"), Value("not even readable"));
}

} // namespace
} // namespace rolvane
