#include "Neighbour.h"

#include <chrono>
#include <csignal>

namespace rolvane::test {
namespace {

constexpr const char* kBusAddress = "DBUS_SESSION_BUS_ADDRESS";
constexpr const char* kNoBus = "unix:path=/nonexistent/bus";

// A user whose daemon was started where another session bus was known than where the commands are typed.
class Apart : public testing::Test {
protected:
    void publishWithDaemonOn(const std::string& address) {
        world.makeAccount();
        world.home.setVariable(kBusAddress, address);
        world.add("Ada");
        world.add("Bea");
        world.group("Family", {"Ada"});
        world.done({"publish"});
        ASSERT_TRUE(world.daemon());
    }
    // Every command that waits for the daemon ends with success, and the daemon is the one that ran before where it
    // need not rest.
    void everyCommandIsServed() {
        const auto daemon = world.daemon();
        world.done({"publish", "--group", "Family"});
        world.done({"edit", "Bea", "--nickname", "Busy"});
        world.done({"sync"});
        EXPECT_NE(contentsOfPeople().find("Busy"), std::string::npos);
        EXPECT_EQ(world.daemon(), daemon);
        Neighbour bob(world, "bob", false);
        bob.done({"add", "--first", "Bob's"});
        bob.done({"publish"});
        bob.done({"share", UserWorld::kUser});
        world.done({"share", "bob"});
        world.done({"subscribe", "bob"});
        EXPECT_EQ(world.json({"list", "--of", "bob"}).size(), 1U);
        world.done({"unshare", "bob"});
        world.done({"unsubscribe", "bob"});
        world.done({"unpublish", "--yes", "--group", "Family"});
        world.done({"sync"});
        world.done({"unpublish", "--yes"});
    }
    std::string contentsOfPeople() {
        std::string all;
        for (const std::string& path : world.tree())
            if (path.starts_with("People/")) all += contentsOf(world.published(path));
        return all;
    }
    CommandWorld world;
};

TEST_F(Apart, ADaemonWithoutABusIsHeardAndHears) {
    publishWithDaemonOn(kNoBus);
    world.bus();
    everyCommandIsServed();
}

TEST_F(Apart, CommandsWithoutABusAreHeardByADaemonOnOne) {
    world.bus();
    const std::string address = world.bus().address();
    publishWithDaemonOn(address);
    world.home.setVariable(kBusAddress, kNoBus);
    everyCommandIsServed();
}

TEST_F(Apart, DaemonAndCommandsOnTwoBusesMeet) {
    PrivateBus other;
    publishWithDaemonOn(other.address());
    world.bus();
    everyCommandIsServed();
}

TEST_F(Apart, WatchSeesThePassesOfADaemonOnAnotherBus) {
    publishWithDaemonOn(kNoBus);
    world.bus();
    auto watching = world.startRolvane({"watch", "--once", "--json"});
    ASSERT_TRUE(watching->waitForLine("watching")) << watching->errors();
    world.done({"sync"});
    const auto ending = watching->wait();
    ASSERT_TRUE(ending);
    EXPECT_TRUE(ending->exitedWith(0)) << watching->errors();
    EXPECT_TRUE(watching->output().find("\"started\"") != std::string::npos) << watching->output();
    EXPECT_TRUE(watching->output().find("\"stopped\"") != std::string::npos) << watching->output();
}

TEST_F(Apart, OnOneBusWatchTellsEachPassOnce) {
    world.bus();
    publishWithDaemonOn(world.bus().address());
    auto watching = world.startRolvane({"watch", "--json"});
    ASSERT_TRUE(watching->waitForLine("watching")) << watching->errors();
    for (int i = 0; i < 3; ++i) world.done({"sync"});
    watching->signal(SIGINT);
    ASSERT_TRUE(watching->wait());
    size_t started = 0;
    const std::string lines = watching->output();
    for (size_t at = lines.find("\"started\""); at != std::string::npos; at = lines.find("\"started\"", at + 1))
        ++started;
    EXPECT_EQ(started, 3U) << lines;
}

// A daemon that runs and answers nobody.
class Stopped : public Apart {
protected:
    Stopped() {
        world.bus();
        publishWithDaemonOn(world.bus().address());
        pid = world.daemon().value_or(0);
        EXPECT_EQ(::kill(pid, SIGSTOP), 0);
    }
    ~Stopped() override { ::kill(pid, SIGCONT); }
    void saysWhatToDo(const std::vector<std::string>& command) {
        const auto start = std::chrono::steady_clock::now();
        const Ran ran = world.rolvane(command);
        const double seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
        EXPECT_EQ(ran.status, kNotReached) << command[0] << ": " << ran;
        EXPECT_NE(ran.errors.find("`rolvane daemon restart`"), std::string::npos) << command[0] << ": " << ran;
        RecordProperty(command[0], std::to_string(seconds));
        constexpr double kMost = 30; // five, and what a loaded machine takes to start a program
        EXPECT_LT(seconds, kMost) << command[0];
    }
    pid_t pid = 0;
};

TEST_F(Stopped, EveryCommandThatWaitsSaysSoWithinSeconds) {
    saysWhatToDo({"sync"});
    saysWhatToDo({"publish", "--group", "Family"});
    saysWhatToDo({"publish"});
    saysWhatToDo({"watch", "--once"});
    saysWhatToDo({"watch"});
    world.store().addUser("bob", UserWorld::kPassword);
    saysWhatToDo({"share", "bob"});
    saysWhatToDo({"unshare", "bob"});
}

TEST_F(Stopped, SubscribeSaysSoWithinSeconds) {
    ::kill(pid, SIGCONT);
    Neighbour bob(world, "bob", false);
    bob.done({"add", "--first", "Bob's"});
    bob.done({"publish"});
    bob.done({"share", UserWorld::kUser});
    ::kill(pid, SIGSTOP);
    saysWhatToDo({"subscribe", "bob"});
}

TEST_F(Stopped, ItIsEndedByWhatHasToRest) {
    world.done({"unpublish", "--yes"});
    EXPECT_NE(world.daemon(), pid);
}

TEST_F(Stopped, ARestartMakesItServeAgain) {
    world.done({"daemon", "restart"});
    EXPECT_NE(world.daemon(), pid);
    world.done({"sync"});
}

TEST_F(Stopped, AndOneThatGoesOnServes) {
    auto syncing = world.startRolvane({"sync"});
    ::kill(pid, SIGCONT);
    const auto ending = syncing->wait(60);
    ASSERT_TRUE(ending);
    EXPECT_TRUE(ending->exitedWith(0)) << syncing->errors();
}

} // namespace
} // namespace rolvane::test
