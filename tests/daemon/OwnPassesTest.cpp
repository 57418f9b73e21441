#include "DaemonWorld.h"

#include "support/FakeHttpServer.h"

#include <algorithm>
#include <csignal>

namespace rolvane::test {
namespace {

constexpr double kWhole = 90; // seconds that everything may take on a loaded machine

TEST(PassesOfTheDaemonsOwn, SendWhatWaitedWhenTheStoreIsBackWithoutAnybodysDoing) {
    DaemonWorld world;
    world.addPeople(3);
    world.saveAccountOn(world.store());
    world.publishEverything();
    const auto daemon = world.serving();
    ASSERT_EQ(world.differences(), "") << daemon->errors();
    world.store().stop(PrivateStore::Stop::atOnce);
    world.addPeople(1, "Late");
    const auto waits = [&] { return world.pendingChanges() > 0; };
    for (int i = 0; i < kWhole * 20 && !waits(); ++i) daemon->wait(0.05);
    ASSERT_TRUE(waits()) << daemon->errors();
    world.store().start();
    const auto settled = [&] { return world.pendingChanges() == 0 && world.differences().empty(); };
    for (int i = 0; i < kWhole * 20 && !settled(); ++i) daemon->wait(0.05);
    EXPECT_EQ(world.differences(), "") << daemon->errors();
    EXPECT_EQ(world.pendingChanges(), 0U) << daemon->errors();
    EXPECT_TRUE(daemon->running());
}

TEST(PassesOfTheDaemonsOwn, AreNoneInAProcessThatEndsWhenItIsIdle) {
    DaemonWorld world;
    world.setDebugLevel(1);
    world.subscribeFarAway();
    world.addPeople(1);
    world.publishEverything();
    const auto daemon = world.startManager({"-p"});
    const auto ending = daemon->wait(kWhole);
    ASSERT_TRUE(ending);
    EXPECT_TRUE(ending->exitedWith(0)) << daemon->errors();
    EXPECT_EQ(linesWith(daemon->errors(), "Killing RolvaneManager"), 1U) << daemon->errors();
    EXPECT_EQ(linesWith(daemon->errors(), "Vaultra is offline"), 1U) << "one pass: " << daemon->errors();
    EXPECT_GT(world.pendingChanges(), 0U);
}

// While the store is away an attempt is one question, in two requests that go out together, which no pass follows.
TEST(PassesOfTheDaemonsOwn, AskAStoreThatIsAwayWhetherItIsThereAndNothingElse) {
    std::atomic<int> requests = 0;
    FakeHttpServer portal([&](const FakeRequest&) {
        ++requests;
        return FakeAnswer::status(503, "Closed for today.");
    });
    DaemonWorld world;
    world.saveAccountOnPlain(portal.port());
    world.addPeople(1);
    world.publishEverything();
    const auto daemon = world.serving();
    const int afterTheFirstPass = requests;
    const auto isAsked = [&] { // the two may arrive in either order
        const auto all = portal.requests();
        return std::ranges::any_of(all.begin() + afterTheFirstPass, all.end(),
                                   [](const FakeRequest& request) { return request.method == "OPTIONS"; });
    };
    for (int i = 0; i < kWhole * 20 && !isAsked(); ++i) daemon->wait(0.05);
    EXPECT_TRUE(isAsked()) << daemon->errors();
    for (int i = 0; i < 20; ++i) daemon->wait(0.05); // whatever else would follow
    EXPECT_LE(requests, afterTheFirstPass + 2);
    EXPECT_EQ(linesWith(daemon->errors(), "Vaultra is offline"), 1U) << daemon->errors();
}

} // namespace
} // namespace rolvane::test
