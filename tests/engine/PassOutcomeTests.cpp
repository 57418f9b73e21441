#include "engine/pass/PassOutcome.h"

#include "EngineWorld.h"
#include "foundation/CXException.h"

#include <gtest/gtest.h>

namespace rolvane::test {
namespace {

const char* const kBob = "http://store.example/bob/Contacts";

// An engine whose passes' outcomes are kept.
class PassOutcomes : public testing::Test {
protected:
    World world;
    std::vector<PassOutcome> told;
    std::vector<PassFailure> failures;

    CXDSyncEngine& start() {
        EngineCollaborators with = world.collaborators();
        with.passEnded = [this](const PassOutcome& outcome) { told.push_back(outcome); };
        with.takeFailures = [this] { return std::exchange(failures, {}); };
        world.engine.reset();
        world.engine = std::make_unique<CXDSyncEngine>(with);
        return *world.engine;
    }
    void reachStore() { world.engine->storeWasTested(true, 0, {}); }
    PassOutcome stored() const { return lastOutcome(world.preferences).value_or(PassOutcome()); }
};

TEST_F(PassOutcomes, AnOutcomeIsTheSameAfterItWasStored) {
    PassOutcome outcome;
    outcome.number = 7;
    outcome.began = Date(10);
    outcome.ended = Date(20.5);
    outcome.beganSinceBoot = 3.25;
    outcome.full = outcome.storeReached = outcome.anotherFollows = true;
    outcome.storeFailure = PassFailure{"PUT", "http://a/b", 507, -1011, "no room", 12.5};
    outcome.exception = "e";
    outcome.storage = "s";
    PassTree tree{UserName("bob"), kBob, true, true, true, {}, {}};
    tree.out = {true, true, 1, 2, 3, Date(4), Date(5), PassFailure{"GET", "u", 403, 0, "w", std::nullopt}};
    tree.in = {true, false, 6, 7, 8, std::nullopt, Date(9), std::nullopt};
    outcome.trees = {PassTree{kSelf, "x", false, false, false, {}, {}}, tree};
    EXPECT_EQ(decodeOutcome(encodeOutcome(outcome)), outcome);
    EXPECT_EQ(decodeOutcome(encodeOutcome(PassOutcome())), PassOutcome());
}

TEST_F(PassOutcomes, ValuesThatAreNoOutcomeAreNone) {
    EXPECT_FALSE(decodeOutcome(Value()));
    EXPECT_FALSE(decodeOutcome("text"));
    EXPECT_FALSE(decodeOutcome(Dictionary{{"ended", 5}}));
}

TEST_F(PassOutcomes, APassIsPutDownOnceAndToldAtItsEnd) {
    start();
    world.cx->whenOpening = [&] { reachStore(); };
    int heard = 0;
    const auto hears = world.distributed.observe(
        kCXDPassEndedNotification,
        [&](const Notification& n) {
            ++heard;
            EXPECT_EQ(decodeOutcome(n.userInfo)->number, 1);
        },
        true);
    world.engine->bringSourcesUpToDate();
    ASSERT_EQ(told.size(), 1u);
    EXPECT_EQ(heard, 1);
    EXPECT_EQ(stored(), told[0]);
    EXPECT_EQ(told[0].number, 1);
    EXPECT_TRUE(told[0].full);
    EXPECT_TRUE(everythingIsUpToDate(told[0]));
    ASSERT_EQ(told[0].trees.size(), 1u);
    EXPECT_EQ(told[0].trees[0].user, kSelf);
    EXPECT_EQ(told[0].trees[0].location, "http://store.example/ann/Contacts");
}

TEST_F(PassOutcomes, AStoreThatIsNotReachedLeavesNothingUpToDate) {
    world.subscribe(kBob);
    start();
    world.offLine = true;
    world.vaultra->whenOpening = [&] { world.engine->storeWasTested(false, -1004, "Nobody answers."); };
    world.engine->bringSourcesUpToDate();
    EXPECT_FALSE(everythingIsUpToDate(stored()));
    EXPECT_TRUE(everythingIsSent(stored()));
    const PassTree* bob = stored().tree(UserName("bob")) ? &told[0].trees[1] : nullptr;
    ASSERT_TRUE(bob);
    EXPECT_FALSE(bob->in.reached);
    ASSERT_TRUE(bob->in.why);
    EXPECT_EQ(bob->in.why->error, -1004);
    EXPECT_EQ(bob->in.waitingSince, told[0].ended);
}

TEST_F(PassOutcomes, WaitingCountsFromTheFirstPassThatLeftIt) {
    start();
    world.vaultra->whenOpening = [&] { reachStore(); };
    world.vaultra->whenApplying = [&](const CXDChangeRecordPtr&, bool*) {
        failures.push_back({"PUT", "http://store.example/ann/Contacts/People/x", 507, 0, "no room", std::nullopt});
        return false;
    };
    world.engine->applyChangeRecords({update("x")});
    const Date first = stored().ended;
    EXPECT_FALSE(stored().full);
    EXPECT_FALSE(everythingIsSent(stored()));
    EXPECT_EQ(stored().trees[0].out.waiting, 1);
    ASSERT_TRUE(stored().trees[0].out.why);
    EXPECT_EQ(stored().trees[0].out.why->status, 507);
    world.clock.advance(60);
    world.engine->bringSourcesUpToDate();
    EXPECT_EQ(stored().trees[0].out.waitingSince, first);
    EXPECT_EQ(stored().number, 2);
    world.vaultra->whenApplying = nullptr;
    world.clock.advance(60);
    world.engine->bringSourcesUpToDate();
    EXPECT_EQ(stored().trees[0].out.waitingSince, std::nullopt);
    EXPECT_EQ(stored().trees[0].out.inStep, stored().ended);
    EXPECT_EQ(stored().trees[0].out.carried, 1);
    EXPECT_TRUE(everythingIsUpToDate(stored()));
}

TEST_F(PassOutcomes, AnExceptionThatEndsThePassIsNamed) {
    start();
    world.vaultra->whenOpening = [] { throw CXException("Any", "the roof came down"); };
    world.engine->bringSourcesUpToDate();
    EXPECT_EQ(stored().exception, "the roof came down");
    EXPECT_FALSE(everythingIsUpToDate(stored()));
    EXPECT_FALSE(everythingIsSent(stored()));
}

TEST_F(PassOutcomes, ARefusalIsToldByTheRetryToo) {
    start();
    world.vaultra->whenOpening = [&] { reachStore(); };
    world.vaultra->whenApplying = [](const CXDChangeRecordPtr&, bool* denied) { return !(*denied = true); };
    world.engine->applyChangeRecords({update("x")});
    EXPECT_EQ(stored().trees[0].out.refused, 1);
    EXPECT_TRUE(stored().anotherFollows);
    world.vaultra->whenApplying = nullptr;
    world.turn();
    EXPECT_EQ(stored().number, 2);
    EXPECT_EQ(stored().trees[0].out.refused, 1);
    EXPECT_FALSE(stored().anotherFollows);
    EXPECT_FALSE(everythingIsUpToDate(stored()));
    world.engine->bringSourcesUpToDate();
    EXPECT_EQ(stored().trees[0].out.refused, 1) << "the owner's own stands there until the store has taken it";
    world.clock.advance(60);
    world.engine->applyChangeRecords({update("x")});
    EXPECT_EQ(stored().trees[0].out.refused, 0);
}

TEST_F(PassOutcomes, APassThatTheProcessDoesNotOutliveIsPutDown) {
    start();
    world.vaultra->whenOpening = [&] {
        world.engine->storeWasTested(false, -1012, "The password was refused.");
        world.engine->cancel();
    };
    EXPECT_THROW(world.engine->bringSourcesUpToDate(), Ended);
    EXPECT_EQ(stored().number, 1);
    ASSERT_TRUE(firstFailure(stored()));
    EXPECT_EQ(firstFailure(stored())->error, -1012);
    EXPECT_FALSE(everythingIsUpToDate(stored()));
}

TEST_F(PassOutcomes, AWishIsAnsweredByAPassThatBeganAfterIt) {
    start();
    world.vaultra->whenOpening = [&] { reachStore(); };
    world.engine->bringSourcesUpToDate();
    const PassWish wish = wishForAPass(world.preferences);
    EXPECT_FALSE(answers(stored(), wish));
    world.engine->bringSourcesUpToDate();
    EXPECT_TRUE(answers(stored(), wish));
    PassWish during = wish; // made while a pass ran that was put down afterwards
    during.sinceBoot = stored().beganSinceBoot + 1;
    EXPECT_FALSE(answers(stored(), during));
}

} // namespace
} // namespace rolvane::test
