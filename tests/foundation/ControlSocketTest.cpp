#include "foundation/CXException.h"
#include "foundation/ControlServer.h"
#include "foundation/DaemonNotifications.h"
#include "foundation/RunLoop.h"
#include "support/CapturingLog.h"
#include "support/ChildProcess.h"
#include "support/PrivateBus.h"
#include "support/TempHome.h"
#include "support/WaitUntil.h"

#include <atomic>
#include <filesystem>
#include <random>
#include <thread>

#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

#include <gtest/gtest.h>

using namespace rolvane;
using namespace rolvane::test;

namespace {

ControlMessage postOf(const std::string& name, Dictionary userInfo = {}) {
    ControlMessage message;
    message.kind = ControlMessage::Kind::post;
    message.notification = {name, std::nullopt, std::move(userInfo)};
    return message;
}

} // namespace

TEST(ControlMessages, EveryKindIsReadAsItWasWrittenHoweverItsBytesArrive) {
    ControlMessage post = postOf("News", {{"text", "häh"}, {"number", 7}, {"list", Array{1, 2.5, true}}});
    post.notification.object = "who";
    post.number = 3;
    ControlMessage observe;
    observe.kind = ControlMessage::Kind::observe;
    observe.names = {"One", "Two"};
    ControlMessage heard;
    heard.kind = ControlMessage::Kind::heard;
    heard.number = 3;
    heard.observed = true;
    const std::string bytes = post.frame() + observe.frame() + heard.frame();
    for (const size_t step : {size_t{1}, size_t{3}, bytes.size()}) {
        ControlReader reader;
        std::vector<ControlMessage> all;
        for (size_t at = 0; at < bytes.size(); at += step) {
            reader.append(std::string_view(bytes).substr(at, step));
            while (auto message = reader.next()) all.push_back(*message);
        }
        ASSERT_EQ(all.size(), 3U) << step;
        EXPECT_EQ(all[0].notification.name, "News");
        EXPECT_EQ(all[0].notification.object, "who");
        EXPECT_EQ(all[0].notification.userInfo, post.notification.userInfo);
        EXPECT_EQ(all[0].number, 3);
        EXPECT_EQ(all[1].names, observe.names);
        EXPECT_EQ(all[2].kind, ControlMessage::Kind::heard);
        EXPECT_TRUE(all[2].observed);
    }
}

TEST(ControlMessages, BytesThatAreNoFrameAreRefusedAndNothingLargerThanAFrameIsKept) {
    for (const std::string& bytes :
         {std::string("\x00\x20\x00\x00", 4), std::string("GET / HTTP/1.1\r\n"), std::string("\x00\x00\x00\x01\xff", 5),
          std::string("\x00\x00\x00\x02\x11\x00", 6)}) {
        ControlReader reader;
        reader.append(bytes);
        EXPECT_THROW(reader.next(), CXException);
    }
    EXPECT_THROW(postOf("Large", {{"text", std::string(ControlMessage::kMostBytes, 'x')}}).frame(), CXException);
    std::mt19937 random(7);
    const std::string good = postOf("News", {{"text", "some"}}).frame();
    for (int round = 0; round < 20'000; ++round) {
        std::string bytes = good;
        bytes[random() % bytes.size()] = static_cast<char>(random());
        ControlReader reader;
        reader.append(bytes);
        try {
            while (reader.next()) {
            }
        } catch (const CXException&) { // refused, which is all that is asked
        }
    }
}

namespace {

// A daemon's channel and a command's link in one process, each with a loop's turn when something is waited for.
struct Ends : testing::Test {
    TempHome home;
    RunLoop loop;
    std::string path = home / "runtime/control";
    std::unique_ptr<DaemonChannel> daemon;
    std::unique_ptr<DaemonLink> command;
    std::vector<std::string> heard;

    void start(bool serving = true) {
        daemon = std::make_unique<DaemonChannel>(loop);
        daemon->listen(path);
        if (serving) daemon->serve();
    }
    void type() {
        command = std::make_unique<DaemonLink>(loop, [this] { return std::optional(path); });
    }
    [[nodiscard]] ObservationHandle listen(DistributedNotifications& end, const std::string& name,
                                           bool coalesce = false) {
        return end.observe(
            name, [this](const Notification& n) { heard.push_back(n.name + n.userInfo["n"].description()); }, coalesce);
    }
    testing::AssertionResult hears(size_t count) {
        return waitUntil(
            loop, [&] { return heard.size() >= count; }, std::to_string(count) + " notifications");
    }
    testing::AssertionResult answered(std::optional<int64_t> number) {
        if (!number) return testing::AssertionFailure() << "no socket leads to the daemon";
        return waitUntil(
            loop, [&] { return command->socket().heard(*number).has_value(); }, "the answer");
    }
    // What was posted before has arrived: both carriers keep the order.
    testing::AssertionResult settle(DistributedNotifications& from, DistributedNotifications& to) {
        int marked = 0;
        auto marker = to.observe(
            "Marker", [&](const Notification&) { ++marked; }, false);
        const auto seen = waitUntil(
            loop,
            [&] {
                return marked > 0 || !from.post({"Marker", {}, {}});
            },
            "the marker");
        for (int i = 0; i < 20; ++i) loop.runOnce(0.005);
        return seen;
    }
};

} // namespace

TEST_F(Ends, WithoutABusBothHearEachOther) {
    start();
    type();
    EXPECT_TRUE(command->connected());
    auto asked = listen(*daemon, "Ask");
    ASSERT_TRUE(command->post({"Ask", {}, {{"n", 1}}}));
    ASSERT_TRUE(hears(1));
    auto told = listen(*command, "Told");
    ASSERT_TRUE(waitUntil(
        loop,
        [&] {
            return daemon->post({"Told", {}, {{"n", 2}}});
        },
        "the daemon to know what is observed"));
    ASSERT_TRUE(hears(2));
    EXPECT_EQ(heard, (std::vector<std::string>{"Ask1", "Told2"}));
    EXPECT_FALSE(daemon->post({"Unheard", {}, {}})) << "nobody observes it";
}

TEST_F(Ends, OnOneBusAndTheSocketEachIsDeliveredOnce) {
    PrivateBus bus;
    home.setVariable("DBUS_SESSION_BUS_ADDRESS", bus.address());
    start();
    type();
    auto asked = listen(*daemon, "Ask");
    auto told = listen(*command, "Told");
    ASSERT_TRUE(command->socket().connect());
    std::vector<std::string> expected;
    for (int i = 0; i < 100; ++i) {
        command->post({"Ask", {}, {{"n", i}}});
        expected.push_back("Ask" + std::to_string(i));
    }
    ASSERT_TRUE(hears(100));
    ASSERT_TRUE(settle(*command, *daemon));
    for (int i = 0; i < 100; ++i) {
        daemon->post({"Told", {}, {{"n", i}}});
        expected.push_back("Told" + std::to_string(i));
    }
    ASSERT_TRUE(hears(200));
    ASSERT_TRUE(settle(*daemon, *command));
    EXPECT_EQ(heard, expected);
}

TEST_F(Ends, OneThatOnlyTheBusBringsIsHeardToo) {
    PrivateBus bus;
    home.setVariable("DBUS_SESSION_BUS_ADDRESS", bus.address());
    start();
    auto asked = listen(*daemon, "Ask");
    ChildProcess emit({"busctl", "--address=" + bus.address(), "emit", "/net/rolvane/Notifications",
                       "net.rolvane.Notifications", "Ask", "a{sv}", "1", "n", "x", "5"});
    ASSERT_TRUE(emit.wait());
    ASSERT_TRUE(hears(1));
    EXPECT_EQ(heard, std::vector<std::string>{"Ask5"});
}

TEST_F(Ends, TheDaemonAnswersWhileItsLoopDoesNotTurnAndSaysWhetherAnybodyActs) {
    start();
    type();
    auto asked = listen(*daemon, "Ask");
    RunLoop commands;
    command = std::make_unique<DaemonLink>(commands, [this] { return std::optional(path); });
    const auto acts = command->postForAnswer({"Ask", {}, {}}), idle = command->postForAnswer({"Other", {}, {}});
    ASSERT_TRUE(acts && idle);
    ASSERT_TRUE(waitUntil(
        commands, [&] { return command->socket().heard(*idle).has_value(); }, "the answers"));
    EXPECT_EQ(command->socket().heard(*acts), true);
    EXPECT_EQ(command->socket().heard(*idle), false);
    EXPECT_TRUE(heard.empty()) << "the daemon's loop has not turned";
    ASSERT_TRUE(hears(1));
}

TEST_F(Ends, WhatComesWhileTheDaemonStartsIsKeptUntilItServes) {
    start(false);
    type();
    ASSERT_TRUE(answered(command->postForAnswer({"Ask", {}, {{"n", 1}}})));
    auto asked = listen(*daemon, "Ask");
    daemon->serve();
    ASSERT_TRUE(hears(1));
    EXPECT_EQ(heard, std::vector<std::string>{"Ask1"});
}

TEST_F(Ends, EqualOnesFromBothCarriersAreOneForWhoCoalesces) {
    PrivateBus bus;
    home.setVariable("DBUS_SESSION_BUS_ADDRESS", bus.address());
    start();
    type();
    auto asked = listen(*daemon, "Ask", true);
    daemon->setSuspended(true);
    for (int i = 0; i < 5; ++i) command->post({"Ask", {}, {{"n", i}}});
    ASSERT_TRUE(answered(command->postForAnswer({"Ask", {}, {{"n", 5}}})));
    ASSERT_TRUE(settle(*command, *command)); // the bus has them, too
    daemon->setSuspended(false);
    ASSERT_TRUE(hears(1));
    for (int i = 0; i < 20; ++i) loop.runOnce(0.005);
    EXPECT_EQ(heard, std::vector<std::string>{"Ask5"});
}

TEST_F(Ends, ADaemonThatStartsLaterOrAnewIsFound) {
    type();
    EXPECT_FALSE(command->connected());
    auto told = listen(*command, "Told");
    for (int i = 0; i < 3; ++i) {
        start();
        ASSERT_TRUE(waitUntil(
            loop,
            [&] {
                return daemon->post({"Told", {}, {{"n", i}}});
            },
            "the command to be there"));
        ASSERT_TRUE(hears(static_cast<size_t>(i) + 1));
        daemon.reset();
        EXPECT_FALSE(std::filesystem::exists(path));
        ASSERT_TRUE(waitUntil(
            loop, [&] { return !command->socket().connected(); }, "the end to be noticed"));
    }
    EXPECT_EQ(heard, (std::vector<std::string>{"Told0", "Told1", "Told2"}));
}

TEST_F(Ends, TheSocketOfAKilledDaemonIsReplaced) {
    ASSERT_FALSE(::fork() == 0 && (listenAtPath(path), std::_Exit(0), true));
    ASSERT_NE(::wait(nullptr), -1);
    ASSERT_TRUE(std::filesystem::exists(path));
    type();
    EXPECT_FALSE(command->connected()) << "nobody listens there";
    start();
    EXPECT_TRUE(command->connected());
}

TEST_F(Ends, ItsFileIsThePersonsAlone) {
    const mode_t before = ::umask(0);
    start();
    ::umask(before);
    struct stat info {};
    ASSERT_EQ(::stat(path.c_str(), &info), 0);
    EXPECT_EQ(info.st_mode & 07777, 0600U);
    const std::string usual = controlSocketPath();
    ASSERT_EQ(::stat(std::filesystem::path(usual).parent_path().c_str(), &info), 0);
    EXPECT_EQ(info.st_mode & 07777, 0700U);
}

// Only root can be another user for a moment, so there are tests of it where root runs them.
class EndsAndAStranger : public Ends, public testing::WithParamInterface<uid_t> {};

TEST_P(EndsAndAStranger, AnotherUserIsLetGoWithoutAnAnswer) {
    start();
    ASSERT_EQ(::chmod(path.c_str(), 0666), 0);
    for (const std::string& way : {home.path(), home / "runtime"}) ASSERT_EQ(::chmod(way.c_str(), 0755), 0);
    auto asked = listen(*daemon, "Ask");
    const pid_t stranger = ::fork();
    if (stranger == 0) {
        if (::setresuid(GetParam(), GetParam(), GetParam()) != 0) std::_Exit(9);
        if (connectToPath(path)) std::_Exit(1); // somebody else's daemon is none for this one
        sockaddr_un address{};
        address.sun_family = AF_UNIX;
        path.copy(address.sun_path, sizeof address.sun_path - 1);
        const int fd = ::socket(AF_UNIX, SOCK_STREAM, 0);
        if (::connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) std::_Exit(2);
        const std::string frame = postOf("Ask", {{"n", 1}}).frame();
        (void)!::send(fd, frame.data(), frame.size(), MSG_NOSIGNAL);
        char byte = 0;
        std::_Exit(::recv(fd, &byte, 1, 0) > 0 ? 3 : 0); // the end, or a reset
    }
    int status = -1;
    ASSERT_EQ(::waitpid(stranger, &status, 0), stranger);
    EXPECT_EQ(WEXITSTATUS(status), 0);
    for (int i = 0; i < 20; ++i) loop.runOnce(0.005);
    EXPECT_TRUE(heard.empty());
}

constexpr uid_t kNobody = 65534;
GTEST_ALLOW_UNINSTANTIATED_PARAMETERIZED_TEST(EndsAndAStranger);
INSTANTIATE_TEST_SUITE_P(Whom, EndsAndAStranger,
                         testing::ValuesIn(::geteuid() == 0 ? std::vector{kNobody} : std::vector<uid_t>()));

TEST_F(Ends, APathThatIsTooLongForAnAddressServesAsWell) {
    path = home / "runtime/" + std::string(120, 'd');
    std::filesystem::create_directory(path);
    path += "/control";
    start();
    type();
    EXPECT_TRUE(command->connected());
}

TEST_F(Ends, WithoutAPlaceForTheSocketTheDaemonGoesOnAndSaysSo) {
    const CapturingLog log;
    path = home / "missing/control";
    start();
    type();
    EXPECT_FALSE(command->connected());
    EXPECT_FALSE(command->postForAnswer({"Ask", {}, {}}));
    EXPECT_NE(log.text().find("by the session bus only"), std::string::npos) << log.text();
}

TEST_F(Ends, APeerThatDoesNotReadLosesProgressFirstAndHoldsNobodyUp) {
    start();
    const OwnedDescriptor deaf = connectToPath(path);
    ControlMessage observe;
    observe.kind = ControlMessage::Kind::observe;
    observe.names = {"CXDSyncProgressNotification", "Told"};
    const std::string frame = observe.frame();
    ASSERT_EQ(::send(deaf.get(), frame.data(), frame.size(), 0), static_cast<ssize_t>(frame.size()));
    ASSERT_TRUE(waitUntil(
        loop,
        [&] {
            return daemon->post({"Told", {}, {{"n", 0}}});
        },
        "the peer to be known"));
    constexpr int kMany = 20'000; // some megabytes
    for (int i = 0; i < kMany; ++i) daemon->post({"CXDSyncProgressNotification", {}, {{"n", i}}});
    daemon->post({"Told", {}, {{"n", 1}}});
    ControlReader reader;
    std::vector<std::string> told;
    size_t progress = 0;
    ASSERT_TRUE(waitUntil(
        loop,
        [&] {
            char bytes[65536];
            ssize_t n = 0;
            while ((n = ::recv(deaf.get(), bytes, sizeof bytes, MSG_DONTWAIT)) > 0)
                reader.append({bytes, static_cast<size_t>(n)});
            while (auto message = reader.next())
                if (message->notification.name == "Told")
                    told.push_back(message->notification.userInfo["n"].description());
                else
                    ++progress;
            return told.size() == 2;
        },
        "both that may not be dropped"));
    EXPECT_EQ(told, (std::vector<std::string>{"0", "1"}));
    EXPECT_LT(progress, static_cast<size_t>(kMany)) << "the test has not filled the socket";
}

TEST_F(Ends, APeerThatTalksNonsenseIsLetGoAndTheOthersGoOn) {
    const CapturingLog log;
    start();
    type();
    auto asked = listen(*daemon, "Ask");
    const OwnedDescriptor fool = connectToPath(path);
    ASSERT_EQ(::send(fool.get(), "GET / HTTP/1.1\r\n\r\n", 18, 0), 18);
    ASSERT_TRUE(waitUntil(
        loop,
        [&] {
            char byte = 0;
            return ::recv(fool.get(), &byte, 1, MSG_DONTWAIT) == 0;
        },
        "the end of the connection"));
    command->post({"Ask", {}, {{"n", 1}}});
    EXPECT_TRUE(hears(1));
}

// It sends without an end and faster than anybody could read.
TEST_F(Ends, APeerThatNeverCeasesToSendKeepsNobodyElseWaiting) {
    start();
    type();
    auto asked = listen(*daemon, "Ask");
    std::string flood;
    const std::string frame = postOf("N").frame(); // taking it apart costs more than sending it
    while (flood.size() < (size_t{1} << 20)) flood += frame;
    const OwnedDescriptor fool = connectToPath(path);
    ASSERT_TRUE(fool);
    std::atomic<bool> sent = false;
    std::jthread sending([&](const std::stop_token& enough) {
        while (!enough.stop_requested()) {
            size_t at = 0; // frames stay whole
            while (at < flood.size() && !enough.stop_requested()) {
                const ssize_t n = ::send(fool.get(), flood.data() + at, flood.size() - at, MSG_NOSIGNAL);
                if (n > 0) at += static_cast<size_t>(n);
            }
            sent = true;
        }
    });
    ASSERT_TRUE(waitUntil(
        loop, [&] { return sent.load(); }, "the flood"));
    for (int i = 0; i < 5; ++i) ASSERT_TRUE(answered(command->postForAnswer({"Ask", {}, {{"n", i}}})));
    EXPECT_TRUE(hears(5));
}

// Another program of the same person asks.
TEST_F(Ends, AProgramThatTakesEveryPlaceLeavesRoomForTheOthers) {
    start();
    std::vector<OwnedDescriptor> held(ControlServer::kMostPeers);
    for (OwnedDescriptor& each : held) // the server takes them when it comes to it
        ASSERT_TRUE(waitUntil(
            loop,
            [&] {
                each = connectToPath(path);
                return static_cast<bool>(each);
            },
            "a place in the line"));
    char byte = 0;
    const auto isLetGo = [&](const OwnedDescriptor& each) {
        return ::recv(each.get(), &byte, 1, MSG_DONTWAIT) == 0 || errno == ECONNRESET;
    };
    ASSERT_TRUE(waitUntil(
        loop, [&] { return isLetGo(held.back()); }, "the last one to be let go"));
    const pid_t other = ::fork();
    if (other == 0) {
        const OwnedDescriptor socket = connectToPath(path);
        ControlMessage ask = postOf("Ask");
        ask.number = 1;
        const std::string frame = ask.frame();
        if (!socket || ::send(socket.get(), frame.data(), frame.size(), MSG_NOSIGNAL) < 0) std::_Exit(2);
        pollfd answer = {socket.get(), POLLIN, 0};
        (void)!::poll(&answer, 1, -1);
        std::_Exit(::recv(socket.get(), &byte, 1, 0) > 0 ? 0 : 3);
    }
    int status = -1;
    ASSERT_EQ(::waitpid(other, &status, 0), other);
    EXPECT_EQ(WEXITSTATUS(status), 0);
    EXPECT_FALSE(isLetGo(held.front())) << "the first ones stay";
}

TEST_F(Ends, APeerThatObservesTooManyNamesIsLetGo) {
    start();
    const OwnedDescriptor fool = connectToPath(path);
    ControlMessage observe;
    observe.kind = ControlMessage::Kind::observe;
    for (size_t i = 0; i <= ControlServer::kMostNames; ++i) observe.names.push_back("Name" + std::to_string(i));
    const std::string frame = observe.frame();
    ASSERT_EQ(::send(fool.get(), frame.data(), frame.size(), 0), static_cast<ssize_t>(frame.size()));
    EXPECT_TRUE(waitUntil(
        loop,
        [&] {
            char byte = 0;
            return ::recv(fool.get(), &byte, 1, MSG_DONTWAIT) == 0;
        },
        "the end of the connection"));
}

TEST_F(Ends, TenThreadsPostAndEverythingArrivesOnceInTheOrderOfEachThread) {
    start();
    type();
    auto told = listen(*command, "Told");
    ASSERT_TRUE(waitUntil(
        loop,
        [&] {
            return daemon->post({"Told", {}, {{"n", -1}}});
        },
        "the command to be there"));
    constexpr int kThreads = 10, kEach = 200;
    {
        std::vector<std::jthread> threads;
        for (int t = 0; t < kThreads; ++t)
            threads.emplace_back([this, t] {
                for (int i = 0; i < kEach; ++i) daemon->post({"Told", {}, {{"n", t * kEach + i}}});
            });
    }
    ASSERT_TRUE(hears(1 + kThreads * kEach));
    EXPECT_EQ(heard.size(), 1U + kThreads * kEach);
    std::vector<int> last(kThreads, -1);
    for (size_t i = 1; i < heard.size(); ++i) {
        const int n = std::stoi(heard[i].substr(4));
        EXPECT_EQ(n % kEach, last[static_cast<size_t>(n / kEach)] + 1);
        last[static_cast<size_t>(n / kEach)] = n % kEach;
    }
}
