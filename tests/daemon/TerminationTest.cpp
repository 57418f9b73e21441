#include "DaemonWorld.h"

#include <chrono>
#include <csignal>

namespace rolvane::test {
namespace {

constexpr double kPromise = 5; // seconds

class Termination : public testing::Test {
protected:
    // Signals the daemon; fails when it has not ended properly within the promised time.
    void endsBy(ChildProcess& daemon, int signal) {
        const auto began = std::chrono::steady_clock::now();
        daemon.signal(signal);
        const auto ending = daemon.wait();
        const double took = std::chrono::duration<double>(std::chrono::steady_clock::now() - began).count();
        ASSERT_TRUE(ending) << daemon.errors();
        EXPECT_TRUE(ending->exitedWith(0)) << "status " << ending->status << ", signal " << ending->signal << "\n"
                                           << daemon.errors();
        EXPECT_LT(took, kPromise);
    }
    DaemonWorld world;
};

TEST_F(Termination, AnIdleDaemonEndsInOrderBySIGTERM) {
    const auto daemon = world.serving();
    endsBy(*daemon, SIGTERM);
}

TEST_F(Termination, AnIdleDaemonEndsInOrderBySIGINTAndBySIGHUP) {
    for (const int signal : {SIGINT, SIGHUP}) {
        const auto daemon = world.serving();
        endsBy(*daemon, signal);
    }
}

TEST_F(Termination, APassAgainstAStoreThatNeverAnswersIsEndedInTime) {
    const SilentServer silent;
    world.addPeople(20);
    world.saveAccountAt(silent.port());
    world.publishEverything();
    world.setDebugLevel(1);
    const auto daemon = world.startManager();
    ASSERT_TRUE(silent.somebodyWaits(20)) << "the daemon never asked the store:\n" << daemon->errors();
    endsBy(*daemon, SIGTERM);
    EXPECT_EQ(linesWith(daemon->errors(), "Entering main run loop."), 0U) << "the pass was over before the signal";
}

TEST_F(Termination, TerminationInTheMiddleOfAPassLosesNothing) {
    {
        const SilentServer silent;
        world.addPeople(20);
        world.saveAccountAt(silent.port());
        world.publishEverything();
        const auto daemon = world.startManager();
        ASSERT_TRUE(silent.somebodyWaits(20)) << daemon->errors();
        endsBy(*daemon, SIGTERM);
    }
    world.saveAccountOn(world.store());
    world.publishEverything();
    const auto clean = world.startManager({"-p"});
    ASSERT_TRUE(clean->wait());
    EXPECT_EQ(world.differences(), "") << clean->errors();
    EXPECT_EQ(world.pendingChanges(), 0U);
}

TEST_F(Termination, AfterAKillInTheMiddleOfAPublicationACleanPassMakesStoreAndDatabaseEqual) {
    world.saveAccountOn(world.store());
    world.publishEverything();
    constexpr int kPeople = 300, kAttempts = 8;
    bool inTheMiddle = false;
    for (int attempt = 0; attempt < kAttempts && !inTheMiddle; ++attempt) {
        const size_t before = world.tree().size();
        world.addPeople(kPeople, "Person " + std::to_string(attempt));
        const auto daemon = world.startManager();
        while (daemon->running() && world.tree().size() < before + kPeople / 10 + 4) {
        }
        daemon->kill();
        inTheMiddle = world.differences().find("is not on the store") != std::string::npos;
    }
    ASSERT_TRUE(inTheMiddle) << "the daemon was faster than the kill every time";

    const auto clean = world.startManager({"-p"});
    const auto ending = clean->wait();
    ASSERT_TRUE(ending);
    EXPECT_TRUE(ending->exitedWith(0)) << clean->errors();
    EXPECT_EQ(world.differences(), "") << clean->errors();
    EXPECT_EQ(world.pendingChanges(), 0U);
}

} // namespace
} // namespace rolvane::test
