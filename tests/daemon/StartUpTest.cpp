#include "DaemonWorld.h"

#include "foundation/Paths.h"

#include <csignal>
#include <fstream>
#include <sqlite3.h>

namespace rolvane::test {
namespace {

constexpr const char* kPassStarted = "Sharing synchronization update started.";
constexpr const char* kPassCompleted = "Sharing synchronization update completed.";
constexpr double kAWhile = 0.3; // long enough for a timer of zero seconds to fire

void executeSql(const std::string& path, const char* statement) {
    sqlite3* file = nullptr;
    ASSERT_EQ(sqlite3_open(path.c_str(), &file), SQLITE_OK);
    EXPECT_EQ(sqlite3_exec(file, statement, nullptr, nullptr, nullptr), SQLITE_OK) << sqlite3_errmsg(file);
    sqlite3_close(file);
}

class StartUp : public testing::Test {
protected:
    DaemonWorld world;
};

TEST_F(StartUp, WithoutArgumentsItStays) {
    const auto daemon = world.serving();
    EXPECT_FALSE(daemon->wait(kAWhile)) << daemon->errors();
    EXPECT_EQ(linesWith(daemon->errors(), "Parsing arguments."), 1U);
    EXPECT_EQ(linesWith(daemon->errors(), "Checking in with kickerd."), 1U);
}

TEST_F(StartUp, PMakesItEndAsSoonAsItIsIdle) {
    world.subscribeFarAway();
    const auto daemon = world.serving({"-p"});
    const auto ending = daemon->wait();
    ASSERT_TRUE(ending);
    EXPECT_TRUE(ending->exitedWith(0));
    EXPECT_EQ(linesWith(daemon->errors(), kPassCompleted), 1U) << daemon->errors();
    EXPECT_EQ(linesWith(daemon->errors(), "Killing RolvaneManager"), 1U) << daemon->errors();
}

TEST_F(StartUp, WithPAndNothingSharedItEndsWithoutAPass) {
    world.setDebugLevel(1);
    const auto daemon = world.startManager({"-p"});
    const auto ending = daemon->wait();
    ASSERT_TRUE(ending);
    EXPECT_TRUE(ending->exitedWith(0));
    EXPECT_EQ(linesWith(daemon->errors(), kPassStarted), 0U) << daemon->errors();
    EXPECT_EQ(linesWith(daemon->errors(), "Killing RolvaneManager"), 1U) << daemon->errors();
}

TEST_F(StartUp, PTwiceIsOnce) {
    world.subscribeFarAway();
    const auto daemon = world.serving({"-p", "-p"});
    const auto ending = daemon->wait();
    ASSERT_TRUE(ending);
    EXPECT_TRUE(ending->exitedWith(0));
    EXPECT_EQ(linesWith(daemon->errors(), "Killing RolvaneManager"), 1U) << daemon->errors();
}

TEST_F(StartUp, PAmongUnknownArgumentsCountsAndTheyAreIgnored) {
    world.subscribeFarAway();
    const auto daemon = world.serving({"--frobnicate", "x", "-p", "-v"});
    const auto ending = daemon->wait();
    ASSERT_TRUE(ending);
    EXPECT_TRUE(ending->exitedWith(0));
    EXPECT_EQ(linesWith(daemon->errors(), "frobnicate"), 0U);
    EXPECT_EQ(daemon->output(), "");
}

TEST_F(StartUp, OnlyTheExactArgumentMatches) {
    const auto daemon = world.serving({"-P", "-px", "--p", "p", ""});
    EXPECT_FALSE(daemon->wait(kAWhile)) << daemon->errors();
}

TEST_F(StartUp, WithNothingSharedThereIsNoPassYetTheLoopIsEntered) {
    world.addPeople(3);
    const auto daemon = world.serving();
    EXPECT_EQ(linesWith(daemon->errors(), kPassStarted), 0U) << daemon->errors();
    EXPECT_TRUE(daemon->running());
}

TEST_F(StartUp, ARemoteSubscriptionIsReasonForAPass) {
    world.subscribeFarAway();
    const auto daemon = world.serving();
    EXPECT_EQ(linesWith(daemon->errors(), kPassStarted), 1U) << daemon->errors();
    EXPECT_EQ(linesWith(daemon->errors(), kPassCompleted), 1U) << daemon->errors();
}

TEST_F(StartUp, WithPThePassIsDoneWhenTheProcessHasEnded) {
    world.addPeople(30);
    world.saveAccountOn(world.store());
    world.publishEverything();
    const auto daemon = world.startManager({"-p"});
    const auto ending = daemon->wait();
    ASSERT_TRUE(ending);
    EXPECT_TRUE(ending->exitedWith(0)) << daemon->errors();
    EXPECT_EQ(world.differences(), "");
    EXPECT_EQ(world.pendingChanges(), 0U);
}

TEST_F(StartUp, AtDebugLevelZeroItIsSilent) {
    world.addPeople(2);
    world.saveAccountOn(world.store());
    world.publishEverything();
    const auto daemon = world.startManager({"-p"});
    ASSERT_TRUE(daemon->wait());
    EXPECT_EQ(daemon->errors(), "");
    EXPECT_EQ(daemon->output(), "");
}

// What is there when the daemon starts and cannot be used: one line whatever the debug level, status 0, nothing
// changed.
void endsWithOneLineAbout(DaemonWorld& world, const std::string& path) {
    const std::string before = readFile(path);
    const auto daemon = world.startManager();
    const auto ending = daemon->wait();
    ASSERT_TRUE(ending) << daemon->errors();
    EXPECT_TRUE(ending->exitedWith(0));
    const std::string errors = daemon->errors();
    EXPECT_EQ(linesWith(errors, "Quitting due to an unhandled exception: "), 1U) << errors;
    EXPECT_EQ(linesWith(errors, ""), 1U) << "more than one line:\n" << errors;
    EXPECT_EQ(linesWith(errors, path), 1U) << errors;
    EXPECT_EQ(readFile(path), before);
}

TEST_F(StartUp, ADamagedDatabaseEndsItWithOneLineAndStatusZero) {
    const std::string path = dataDirectory() + "/contacts.db";
    std::ofstream(path) << "this is no database, and has never been one, however long one looks at it";
    endsWithOneLineAbout(world, path);
}

TEST_F(StartUp, DamagedPreferencesEndItWithOneLineAndStatusZero) {
    const std::string path = stateDirectory() + "/preferences.db";
    std::ofstream(path) << "these are no preferences, and have never been any, however long one looks at them";
    endsWithOneLineAbout(world, path);
}

TEST_F(StartUp, AnErrorThatReachesTheRunLoopEndsItWithOneLineAndStatusZeroAndLosesNothing) {
    world.bus();
    world.addPeople(2);
    world.saveAccountOn(world.store());
    world.publishEverything();
    const auto daemon = world.serving();
    for (int i = 0; i < 600 && !world.differences().empty(); ++i) daemon->wait(0.05);
    ASSERT_EQ(world.differences(), "") << daemon->errors();

    world.closeDatabase();
    const std::string path = dataDirectory() + "/contacts.db";
    executeSql(path, "ALTER TABLE cursors RENAME TO mislaid");
    const auto ending = daemon->wait();
    ASSERT_TRUE(ending) << daemon->errors();
    EXPECT_TRUE(ending->exitedWith(0)) << daemon->errors();
    EXPECT_EQ(linesWith(daemon->errors(), "Quitting due to an unhandled exception: "), 1U) << daemon->errors();

    executeSql(path, "ALTER TABLE mislaid RENAME TO cursors");
    world.addPeople(1, "Newcomer");
    const auto next = world.serving();
    for (int i = 0; i < 600 && !world.differences().empty(); ++i) next->wait(0.05);
    EXPECT_EQ(world.differences(), "") << next->errors();
}

// Taken for no account, it would end the publication and every subscription, in the database and for good.
TEST_F(StartUp, AnAccountThatIsThereButCannotBeUsedEndsItAndTakesNothingAway) {
    world.addPeople(1);
    world.subscribeFarAway();
    world.publishEverything();
    const std::string path = CXDAVAccount::defaultPath(), good = readFile(path);
    const auto with = [&](const char* from, const std::string& to) {
        std::string text = good;
        return text.replace(text.find(from), std::string_view(from).size(), to);
    };
    for (const std::string& bad :
         {good.substr(0, good.size() / 2), with("https:", "gopher:"), with("automatic", "x")}) {
        std::ofstream(path) << bad;
        world.closeDatabase();
        endsWithOneLineAbout(world, path);
        EXPECT_TRUE(world.database().allGroup()->valueForProperty(kCXRemoteLocationProperty));
        EXPECT_EQ(world.database().subscriptions().size(), 2U);
    }
}

TEST_F(StartUp, APasswordThatCannotBeHadEndsItWithStatusZero) {
    world.addPeople(1);
    world.saveAccountOn(world.store());
    CXDAVAccount account = world.account();
    account.passwordSource = {PasswordSource::Kind::command, "exit 1"};
    account.save();
    world.publishEverything();
    const auto daemon = world.startManager();
    const auto ending = daemon->wait();
    ASSERT_TRUE(ending) << daemon->errors();
    EXPECT_TRUE(ending->exitedWith(0)) << daemon->errors();
    EXPECT_EQ(world.tree(), std::set<std::string>{});
}

TEST_F(StartUp, ASecondDaemonSaysThatOneRunsAndLeavesItAlone) {
    const auto first = world.serving();
    world.setDebugLevel(0);
    const auto second = world.startManager({"-p"});
    const auto ending = second->wait();
    ASSERT_TRUE(ending);
    EXPECT_TRUE(ending->exitedWith(0));
    const std::string expected = "RolvaneManager is already running (process " + std::to_string(first->pid()) + ")";
    EXPECT_EQ(linesWith(second->errors(), expected), 1U) << second->errors();
    EXPECT_EQ(linesWith(second->errors(), ""), 1U) << second->errors();
    EXPECT_TRUE(first->running());
}

TEST_F(StartUp, DaemonsOfTwoUsersDoNotMindEachOther) {
    const auto first = world.serving();
    DaemonWorld other;
    const auto second = other.serving();
    EXPECT_TRUE(first->running());
    EXPECT_TRUE(second->running());
}

// Published, and the same on the store.
std::unique_ptr<ChildProcess> servingGroups(DaemonWorld& world) {
    world.bus();
    world.addPeople(6);
    world.saveAccountOn(world.store());
    CXRolvane& database = world.database();
    for (const char* uid : {"A:CXGroup", "B:CXGroup"}) {
        const CXGroupRef group = CXGroup::initWithUniqueId(UniqueId(uid));
        group->setValue(uid, kCXGroupNameProperty);
        database.addRecord(group);
        for (const CXPersonRef& person : database.allGroup()->members()) group->addMember(person);
    }
    database.save();
    world.publishEverything();
    auto daemon = world.serving();
    for (int i = 0; i < 600 && !world.differences().empty(); ++i) daemon->wait(0.05);
    return daemon;
}

CXGroupRef groupNamed(DaemonWorld& world, const char* uid) {
    return std::dynamic_pointer_cast<CXGroup>(world.database().recordForUniqueId(UniqueId(uid)));
}

TEST_F(StartUp, AGroupThatChangesInEveryWayInOneSaveIsOnTheStoreAsItIs) {
    const auto daemon = servingGroups(world);
    ASSERT_EQ(world.differences(), "") << daemon->errors();
    const CXGroupRef a = groupNamed(world, "A:CXGroup"), b = groupNamed(world, "B:CXGroup");
    const auto members = a->members();
    const CXPersonRef newcomer = CXPerson::create();
    newcomer->setValue("Newcomer", kCXFirstNameProperty);
    world.database().addRecord(newcomer);
    a->addMember(newcomer);
    a->removeMember(members[0]);
    a->addSubgroup(b);
    b->removeMember(members[1]);
    members[1]->setValue("an edit", kCXNoteProperty);
    a->setValue("Renamed", kCXGroupNameProperty);
    world.database().save();
    for (int i = 0; i < 200 && !world.differences().empty(); ++i) daemon->wait(0.05);
    EXPECT_EQ(world.differences(), "") << daemon->errors();
}

TEST_F(StartUp, AGroupsChangeThatWaitedDoesNotOutliveALaterOne) {
    const auto daemon = servingGroups(world);
    ASSERT_EQ(world.differences(), "") << daemon->errors();
    world.store().stop(PrivateStore::Stop::atOnce);
    const CXGroupRef a = groupNamed(world, "A:CXGroup");
    const auto members = a->members();
    a->setValue("First", kCXGroupNameProperty);
    a->removeMember(members[0]);
    a->removeMember(members[1]);
    world.database().save();
    for (int i = 0; i < 600 && world.pendingChanges() == 0; ++i) daemon->wait(0.05);
    ASSERT_GT(world.pendingChanges(), 0U) << daemon->errors();

    world.store().start();
    a->setValue("Second", kCXGroupNameProperty);
    a->addMember(members[0]);
    world.database().save();
    const auto settled = [&] { return world.pendingChanges() == 0 && world.differences().empty(); };
    for (int i = 0; i < 200 && !settled(); ++i) daemon->wait(0.05);
    EXPECT_EQ(world.pendingChanges(), 0U) << daemon->errors();
    EXPECT_EQ(world.differences(), "") << daemon->errors();
}

// The group's file and directory are gone, and everything else is as it is in the database.
void expectNoTraceOfGroupA(DaemonWorld& world, ChildProcess& daemon) {
    const auto traces = [&] {
        std::string found;
        for (const std::string& file : world.tree())
            if (file.starts_with("A:CXGroup")) found += file + "\n";
        return found + world.differences();
    };
    const auto settled = [&] { return world.pendingChanges() == 0 && traces().empty(); };
    for (int i = 0; i < 200 && !settled(); ++i) daemon.wait(0.05);
    EXPECT_EQ(world.pendingChanges(), 0U) << daemon.errors();
    EXPECT_EQ(traces(), "") << daemon.errors();
}

TEST_F(StartUp, AGroupDeletedWithItsMembersInOneSaveLeavesTheStore) {
    const auto daemon = servingGroups(world);
    ASSERT_EQ(world.differences(), "") << daemon->errors();
    const CXGroupRef a = groupNamed(world, "A:CXGroup");
    const auto members = a->members();
    world.database().removeRecord(a);
    world.database().removeRecord(members[0]);
    world.database().removeRecord(members[1]);
    world.database().save();
    expectNoTraceOfGroupA(world, *daemon);
}

TEST_F(StartUp, AGroupDeletedWhileAnOlderChangeOfItWaitsLeavesTheStore) {
    const auto daemon = servingGroups(world);
    ASSERT_EQ(world.differences(), "") << daemon->errors();
    world.store().stop(PrivateStore::Stop::atOnce);
    const CXGroupRef a = groupNamed(world, "A:CXGroup");
    a->setValue("Renamed", kCXGroupNameProperty);
    world.database().save();
    for (int i = 0; i < 600 && world.pendingChanges() == 0; ++i) daemon->wait(0.05);
    ASSERT_GT(world.pendingChanges(), 0U) << daemon->errors();

    world.store().start();
    world.database().removeRecord(a);
    world.database().save();
    expectNoTraceOfGroupA(world, *daemon);
}

TEST_F(StartUp, AContactDeletedWhileAnOlderEditOfItWaitsLeavesTheStore) {
    const auto daemon = servingGroups(world);
    ASSERT_EQ(world.differences(), "") << daemon->errors();
    world.store().stop(PrivateStore::Stop::atOnce);
    const CXPersonRef person = world.database().allGroup()->members()[0];
    person->setValue("an edit", kCXNoteProperty);
    world.database().save();
    for (int i = 0; i < 600 && world.pendingChanges() == 0; ++i) daemon->wait(0.05);
    ASSERT_GT(world.pendingChanges(), 0U) << daemon->errors();

    world.store().start();
    world.database().removeRecord(person);
    world.database().save();
    const auto settled = [&] { return world.pendingChanges() == 0 && world.differences().empty(); };
    for (int i = 0; i < 200 && !settled(); ++i) daemon->wait(0.05);
    EXPECT_EQ(world.pendingChanges(), 0U) << daemon->errors();
    EXPECT_EQ(world.differences(), "") << daemon->errors();
}

TEST_F(StartUp, WhatIsMadeAndDeletedWhileTheStoreIsAwayNeverStaysThere) {
    const auto daemon = servingGroups(world);
    ASSERT_EQ(world.differences(), "") << daemon->errors();
    world.store().stop(PrivateStore::Stop::atOnce);
    const CXPersonRef passing = CXPerson::create();
    passing->setValue("Passing", kCXFirstNameProperty);
    world.database().addRecord(passing);
    groupNamed(world, "B:CXGroup")->addMember(passing);
    const CXGroupRef fleeting = CXGroup::initWithUniqueId(UniqueId("C:CXGroup"));
    fleeting->setValue("Fleeting", kCXGroupNameProperty);
    world.database().addRecord(fleeting);
    fleeting->addMember(passing);
    world.database().save();
    for (int i = 0; i < 600 && world.pendingChanges() == 0; ++i) daemon->wait(0.05);
    ASSERT_GT(world.pendingChanges(), 0U) << daemon->errors();
    world.database().removeRecord(passing);
    world.database().removeRecord(fleeting);
    world.database().save();
    daemon->signal(SIGTERM);
    ASSERT_TRUE(daemon->wait());

    world.store().start();
    std::string log;
    for (int pass = 0; pass < 2; ++pass) {
        const auto next = world.startManager({"-p"});
        ASSERT_TRUE(next->wait());
        log += next->errors();
    }
    EXPECT_EQ(world.differences(), "") << log;
    EXPECT_FALSE(world.tree().contains("C:CXGroup")) << log;
    EXPECT_EQ(world.pendingChanges(), 0U);
}

TEST_F(StartUp, AnEditOfAnotherProcessIsCarriedToTheStore) {
    world.bus();
    world.addPeople(2);
    world.saveAccountOn(world.store());
    world.publishEverything();
    const auto daemon = world.serving();
    world.addPeople(1, "Newcomer");
    for (int i = 0; i < 600 && !world.differences().empty(); ++i) daemon->wait(0.05);
    EXPECT_EQ(world.differences(), "") << daemon->errors();
}

} // namespace
} // namespace rolvane::test
