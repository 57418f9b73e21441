#include "foundation/Paths.h"
#include "support/ChildProcess.h"
#include "support/PrivateBus.h"
#include "support/TempHome.h"

#include <algorithm>
#include <csignal>
#include <cstdlib>
#include <filesystem>

#include <gtest/gtest.h>

using namespace rolvane;
using namespace rolvane::test;
namespace fs = std::filesystem;

TEST(ChildProcess, ItsOutputAndEndingAreWhatItDid) {
    ChildProcess child({"sh", "-c", "echo out; echo err >&2; exit 3"});
    auto ending = child.wait();
    ASSERT_TRUE(ending);
    EXPECT_TRUE(ending->exitedWith(3));
    EXPECT_EQ(child.output(), "out\n");
    EXPECT_EQ(child.errors(), "err\n");
    EXPECT_FALSE(child.running());
}

TEST(ChildProcess, ItGetsTheGivenEnvironmentDirectoryAndInput) {
    TempDirectory directory;
    ChildProcess child(
        ChildProcess::Options{.arguments = {"sh", "-c", "echo $NAME; pwd; cat"},
                              .environment = {{"NAME=value", "PATH=" + std::string(std::getenv("PATH"))}},
                              .directory = directory.path(),
                              .input = "typed"});
    ASSERT_TRUE(child.wait());
    EXPECT_EQ(child.output(), "value\n" + directory.path() + "\ntyped");
}

TEST(ChildProcess, ALineIsFoundOnceOnEitherStreamAndInOrder) {
    ChildProcess child({"sh", "-c", "echo one; echo two; echo one; printf last; cat >/dev/null"});
    EXPECT_EQ(child.waitForLine("^one$"), "one");
    EXPECT_EQ(child.waitForLine("^one$"), "one");
    EXPECT_EQ(child.waitForLine("^two$", 0.01), std::nullopt) << "it came before the second one";
    EXPECT_EQ(child.waitForLine("last", 0.01), std::nullopt) << "it is not a whole line yet";
    child.closeInput();
    EXPECT_EQ(child.waitForLine("last"), "last");
    EXPECT_EQ(child.waitForLine("never"), std::nullopt) << "and does not wait after the end";
}

TEST(ChildProcess, WaitingGivesUpAndASignalEndsIt) {
    ChildProcess child({"sleep", "1000"});
    EXPECT_EQ(child.wait(0.01), std::nullopt);
    EXPECT_TRUE(child.running());
    child.signal(SIGTERM);
    auto ending = child.wait();
    ASSERT_TRUE(ending);
    EXPECT_EQ(ending->signal, SIGTERM);
}

TEST(ChildProcess, AGrandchildThatKeepsTheOutputOpenHoldsUpNobody) {
    ChildProcess child({"sh", "-c", "sleep 1000 & echo $!; exit 0"});
    ASSERT_TRUE(child.wait(20));
    ::kill(std::stoi(child.output()), SIGKILL);
}

TEST(ChildProcess, WritingToOneThatHasEndedHarmsNobody) {
    ChildProcess child({"true"});
    ASSERT_TRUE(child.wait());
    child.writeInput("nobody reads this");
    EXPECT_TRUE(child.wait()->exitedWith(0));
}

TEST(ChildProcess, AProgramThatDoesNotExistIsAnError) {
    EXPECT_THROW(ChildProcess({"/nonexistent/program"}), std::runtime_error);
    EXPECT_THROW(ChildProcess(ChildProcess::Options{.arguments = {"true"}, .directory = "/nonexistent"}),
                 std::runtime_error);
}

TEST(TempHome, ItIsTheHomeWhileItLivesAndIsGoneAfterwards) {
    std::string former = homeDirectory(), path;
    {
        TempHome home;
        path = home.path();
        EXPECT_EQ(homeDirectory(), path);
        EXPECT_EQ(stateDirectory(), path + "/state/rolvane");
        EXPECT_EQ(std::getenv("DBUS_SESSION_BUS_ADDRESS"), nullptr);
        auto environment = home.environment();
        EXPECT_NE(std::find(environment.begin(), environment.end(), "HOME=" + path), environment.end());
        home.setVariable("ROLVANE_TEST_VARIABLE", "set");
        EXPECT_STREQ(std::getenv("ROLVANE_TEST_VARIABLE"), "set");
    }
    EXPECT_EQ(homeDirectory(), former);
    EXPECT_EQ(std::getenv("ROLVANE_TEST_VARIABLE"), nullptr);
    EXPECT_FALSE(fs::exists(path));
}

TEST(PrivateBus, TwoServeAtATimeAndOneMayRestartAtItsAddress) {
    PrivateBus one, two;
    EXPECT_NE(one.address(), two.address());
    auto identityOf = [](const PrivateBus& bus) {
        ChildProcess call({"busctl", "--address=" + bus.address(), "call", "org.freedesktop.DBus",
                           "/org/freedesktop/DBus", "org.freedesktop.DBus", "GetId"});
        EXPECT_TRUE(call.wait());
        return call.output();
    };
    std::string first = identityOf(one);
    EXPECT_NE(first, "");
    EXPECT_NE(first, identityOf(two));
    one.kill();
    EXPECT_EQ(identityOf(one), "");
    one.restart();
    EXPECT_NE(identityOf(one), "");
    EXPECT_NE(identityOf(one), first);
}
