#include "engine/pass/OutOfOrderWork.h"

#include "EngineWorld.h"

#include "foundation/CXException.h"
#include "support/CapturingLog.h"

#include <algorithm>
#include <future>
#include <gtest/gtest.h>
#include <map>

namespace rolvane {
namespace {

using test::makeRecord;
using test::update;
using test::World;
using Strings = std::vector<std::string>;

CXDChangeRecords updates(int count, const char* user = "<self>") {
    CXDChangeRecords records;
    for (int i = 0; i < count; ++i) records.push_back(update(("P" + std::to_string(i)).c_str(), 4, user));
    return records;
}

// Lets everybody go once so many are there.
class Gate {
public:
    explicit Gate(size_t expected) : _expected(expected) {}
    void pass() {
        std::unique_lock guard(_lock);
        ++_here;
        _changed.notify_all();
        _changed.wait(guard, [&] { return _here >= _expected; });
    }

private:
    std::mutex _lock;
    std::condition_variable _changed;
    size_t _expected, _here = 0;
};

class Workers : public ::testing::Test {
protected:
    Workers() { world.start(); }
    World world;
};

TEST_F(Workers, AreThreeUnlessConfiguredOtherwise) {
    Gate gate(3); // opens only for three side by side
    std::atomic<int> calls{0};
    world.vaultra->whenApplying = [&](const CXDChangeRecordPtr&, bool*) {
        if (++calls <= 3) gate.pass();
        return true;
    };
    world.engine->applyChangeRecords(updates(12));
    EXPECT_EQ(world.vaultra->threads(), 3u);
    EXPECT_EQ(world.progress.did, 12);
}

TEST_F(Workers, AreCountedByATextThatIsANumber) {
    world.account.threads = "5";
    Gate gate(5);
    std::atomic<int> calls{0};
    world.vaultra->whenApplying = [&](const CXDChangeRecordPtr&, bool*) {
        if (++calls <= 5) gate.pass();
        return true;
    };
    world.engine->applyChangeRecords(updates(20));
    EXPECT_EQ(world.vaultra->threads(), 5u);
}

TEST_F(Workers, AreTenAtMost) {
    for (const auto& [configured, expected] :
         std::map<int64_t, int64_t>{{-1, -1}, {9, 9}, {10, 10}, {11, 10}, {50, 10}}) {
        world.account.threads = configured;
        EXPECT_EQ(configuredWorkers(world.account), expected);
    }
    world.account.threads = 50;
    Gate gate(10); // all ten are there before any of them goes on, so that none of them can do another's work
    world.vaultra->whenApplying = [&](const CXDChangeRecordPtr&, bool*) {
        gate.pass();
        return true;
    };
    world.engine->applyChangeRecords(updates(10));
    EXPECT_EQ(world.vaultra->threads(), 10u);
}

TEST_F(Workers, BecomeMoreWhileTheyWorkWhenMoreAreWantedThen) {
    Gate first(3), all(10);
    std::atomic<int> calls{0};
    world.vaultra->whenApplying = [&](const CXDChangeRecordPtr&, bool*) {
        const int call = ++calls;
        if (call == 1) world.account.threads = 10; // as of a store that turns out to be far
        if (call <= 3)
            first.pass();
        else if (call <= 13)
            all.pass();
        return true;
    };
    world.engine->applyChangeRecords(updates(40));
    EXPECT_EQ(world.vaultra->threads(), 10u);
    EXPECT_EQ(world.progress.did, 40);
}

TEST_F(Workers, AreNoMoreThanTheRecords) {
    EngineParts parts(world.collaborators());
    parts.conduits = parts.with.makeConduits(*world.engine);
    OutOfOrderWork work(parts, updates(1));
    work.start(3);
    EXPECT_EQ(work.workers(), 1u);
    work.wait();
    work.finish();
    EXPECT_EQ(work.processedCount(), 1u);
}

TEST_F(Workers, WithoutRecordsNoneIsStartedAndTheWaitReturnsAtOnce) {
    EngineParts parts(world.collaborators());
    OutOfOrderWork work(parts, {});
    work.start(3);
    EXPECT_EQ(work.workers(), 0u);
    work.wait();
    EXPECT_EQ(work.processedCount(), 0u);
}

TEST_F(Workers, ACountOfZeroWaitsUntilTheProcessIsAskedToEndAndLosesNothing) {
    world.account.threads = 0;
    std::promise<void> waiting;
    std::thread asks([&] {
        waiting.get_future().wait();
        world.engine->requestTermination();
    });
    world.vaultra->whenOpening = [&] { waiting.set_value(); };
    EXPECT_THROW(world.engine->applyChangeRecords(updates(2)), test::Ended);
    asks.join();
    EXPECT_TRUE(world.vaultra->applied().empty());
    EXPECT_EQ(world.pending(), (Strings{"P0:4", "P1:4"}));
}

TEST_F(Workers, HandleEveryRecordExactlyOnce) {
    world.account.threads = 10;
    world.engine->applyChangeRecords(updates(500));
    Strings applied = world.vaultra->applied();
    std::sort(applied.begin(), applied.end());
    EXPECT_EQ(applied.size(), 500u);
    EXPECT_EQ(std::unique(applied.begin(), applied.end()), applied.end());
    EXPECT_TRUE(world.pending().empty());
}

TEST_F(Workers, TakeTheRecordsFromTheFront) {
    world.account.threads = 1;
    world.engine->applyChangeRecords(updates(5));
    EXPECT_EQ(world.vaultra->applied(), (Strings{"P0", "P1", "P2", "P3", "P4"}));
}

TEST_F(Workers, ApplyTheRecordsOfOneGroupInTheOrderOfTheListAndNeverSideBySide) {
    EngineParts parts(world.collaborators());
    parts.conduits = parts.with.makeConduits(*world.engine);
    std::mutex lock;
    std::map<std::string, int> inside;
    std::map<std::string, Strings> order;
    bool sideBySide = false;
    world.vaultra->whenApplying = [&](const CXDChangeRecordPtr& record, bool*) {
        const std::string group = record->group()->str();
        {
            const std::lock_guard guard(lock);
            sideBySide |= ++inside[group] > 1;
        }
        std::this_thread::yield();
        const std::lock_guard guard(lock);
        --inside[group];
        order[group].push_back(record->person()->str());
        return true;
    };
    CXDChangeRecords records;
    std::map<std::string, Strings> expected;
    for (int i = 0; i < 300; ++i) {
        const std::string person = "P" + std::to_string(1000 + i), group = "G" + std::to_string(i % 3);
        records.push_back(makeRecord(CXDAddGroupToGroup, person.c_str(), group.c_str()));
        expected[group].push_back(person);
    }
    OutOfOrderWork work(parts, records);
    work.start(10);
    work.wait();
    work.finish();
    EXPECT_FALSE(sideBySide);
    EXPECT_EQ(order, expected);
}

TEST_F(Workers, OfTwoUsersOrTwoPeopleDoNotWaitForOneAnother) {
    world.account.threads = 3;
    Gate gate(3); // opens only when all three are inside
    world.vaultra->whenApplying = [&](const CXDChangeRecordPtr&, bool*) {
        gate.pass();
        return true;
    };
    world.engine->applyChangeRecords({update("P1", 4, "ann"), update("P1", 4, "bob"), update("P2", 4, "ann")});
    EXPECT_EQ(world.progress.did, 3);
}

TEST_F(Workers, FoldEveryMembershipIntoTheStateThoughTheyRunSideBySide) {
    world.account.threads = 10;
    CXDChangeRecords records;
    for (int i = 0; i < 200; ++i)
        records.push_back(makeRecord(CXDAddRecordToGroup, ("P" + std::to_string(i) + ":CXPerson").c_str(), "People"));
    world.engine->applyChangeRecords(records);
    const Dictionary groups = world.stored("CXDConduitData")
                                  .dictionary()["CXDVaultra"]
                                  .dictionary()["priorState"]
                                  .dictionary()["<self>"]
                                  .dictionary();
    ASSERT_EQ(groups.count(), 1u);
    EXPECT_EQ(groups.begin()->second.dictionary()["memberUIDState"].array().count(), 200u);
}

TEST_F(Workers, ADenialCancelsTheUsersWaitingRecordsAndNobodyElses) {
    world.account.threads = 1;
    world.vaultra->whenApplying = [](const CXDChangeRecordPtr& record, bool* denied) {
        if (record->user() != UserName("bob")) return true;
        *denied = true;
        return false;
    };
    const auto ann = update("A1", 4, "ann");
    CXDChangeRecords records = updates(3, "bob");
    records.insert(records.begin(), ann);
    world.engine->applyChangeRecords(records, true, false);
    EXPECT_EQ(world.vaultra->applied(), (Strings{"A1", "P0"}));
    EXPECT_TRUE(world.pending().empty());
}

// A source says that it refuses, and nobody takes that back but a source that is asked the next time.
TEST_F(Workers, ADenialStandsUntilASourceSaysOtherwise) {
    world.account.threads = 1;
    world.vaultra->whenApplying = [](const CXDChangeRecordPtr& record, bool* denied) {
        if (record->user() == UserName("bob")) *denied = true;
        return record->user() != UserName("bob");
    };
    world.engine->applyChangeRecords({update("B1", 4, "bob"), update("C1", 4, "carol"), update("C2", 4, "carol")}, true,
                                     false);
    EXPECT_EQ(world.vaultra->applied(), (Strings{"B1", "C1"})) << "the flag still stood when the third one's turn came";
    EXPECT_TRUE(world.pending().empty());
}

TEST_F(Workers, ADenialWhileOthersTakeRecordsIsSafe) {
    world.account.threads = 10;
    world.vaultra->whenApplying = [](const CXDChangeRecordPtr& record, bool* denied) {
        if (record->user() == UserName("bob")) *denied = true;
        return record->user() != UserName("bob");
    };
    CXDChangeRecords records;
    for (int i = 0; i < 400; ++i)
        records.push_back(update(("P" + std::to_string(i)).c_str(), 4, i % 2 ? "bob" : "eve"));
    world.engine->applyChangeRecords(records, true, false);
    EXPECT_EQ(world.progress.did, 400);
    for (const CXDChangeRecordPtr& record : world.engine->getPendingChanges())
        EXPECT_NE(record->user(), UserName("bob"));
}

TEST_F(Workers, ARecordAppliedToOneOfItsSourcesIsCarriedOverForTheOther) {
    EngineParts parts(world.collaborators());
    parts.conduits = parts.with.makeConduits(*world.engine);
    world.vaultra->whenApplying = [](const CXDChangeRecordPtr&, bool*) { return false; };
    const auto record = update("P1", 5);
    OutOfOrderWork work(parts, {record});
    work.start(3);
    work.wait();
    work.finish();
    EXPECT_EQ(record->appliesToSources(), 4);
    EXPECT_EQ(record->appliedToSources(), 1);
    EXPECT_EQ(work.takePending(), CXDChangeRecords{record});
}

TEST_F(Workers, AnExceptionOnOneSideDoesNotPreventTheOther) {
    EngineParts parts(world.collaborators());
    parts.conduits = parts.with.makeConduits(*world.engine);
    world.cx->whenLocating = [] { throw CXException("TestException", "no location"); };
    test::CapturingLog log;
    const auto record = update("P1", 5);
    OutOfOrderWork work(parts, {record});
    work.start(1);
    work.wait();
    work.finish();
    EXPECT_TRUE(log.has("SyncEngine out of order workloop caught (CX) TestException: no location")) << log.text();
    EXPECT_EQ(world.vaultra->applied(), Strings{"P1"});
    EXPECT_EQ(record->appliesToSources(), 1);
    EXPECT_EQ(record->appliedToSources(), 4);
}

TEST_F(Workers, AnExceptionOnTheStoreSideIsLoggedAndTheRecordStays) {
    test::CapturingLog log;
    CXDChangeRecords records = updates(1);
    EngineParts parts(world.collaborators());
    parts.conduits = parts.with.makeConduits(*world.engine);
    world.vaultra->whenLocating = [] { throw CXException("TestException", "no location"); };
    OutOfOrderWork work(parts, records);
    work.start(1);
    work.wait();
    work.finish();
    EXPECT_TRUE(log.has("SyncEngine out of order workloop caught (Vaultra) TestException: no location"));
    EXPECT_EQ(work.takePending(), records);
    EXPECT_EQ(work.processedCount(), 1u);
}

TEST_F(Workers, FindingTheListEmptyTheyEndWithoutCounting) {
    EngineParts parts(world.collaborators());
    parts.conduits = parts.with.makeConduits(*world.engine);
    std::promise<void> go;
    auto released = go.get_future().share();
    world.vaultra->whenApplying = [released](const CXDChangeRecordPtr&, bool*) {
        released.wait();
        return true;
    };
    OutOfOrderWork work(parts, updates(2));
    work.start(2);
    go.set_value();
    work.wait();
    work.finish();
    EXPECT_EQ(work.processedCount(), 2u);
    EXPECT_TRUE(work.takeUntouched().empty());
}

TEST_F(Workers, WhatStaysPendingIsHeldAsBytes) {
    world.vaultra->whenApplying = [](const CXDChangeRecordPtr& record, bool*) {
        record->payload().dictionary().set("seen", true);
        return false;
    };
    const auto record = update("P1");
    const Dictionary tree = record->payload().dictionary();
    world.engine->applyChangeRecords({record});
    EXPECT_FALSE(record->payload().dictionary().isSame(tree));
    EXPECT_EQ(world.engine->getPendingChanges()[0]->payload(), Value(Dictionary{{"First", "P1"}, {"seen", true}}));
}

} // namespace
} // namespace rolvane
