#include "daemon/Watchdog.h"

#include "DaemonWorld.h"

#include "foundation/SignOfLife.h"
#include "support/WaitUntil.h"

#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

namespace rolvane::test {
namespace {

struct WatchdogTest : testing::Test {
    Watchdog::Collaborators world() {
        return {[this] { ++fed; }, [this] { return now.load(); }};
    }
    RunLoop loop;
    std::atomic<double> now = 1000;
    std::atomic<int> fed = 0;
};

TEST_F(WatchdogTest, IsFedAtMostFourTimesInALimitHoweverManySignsThereAre) {
    Watchdog watchdog(loop, 100, world());
    EXPECT_EQ(fed, 1) << "at once";
    for (int i = 0; i < 1000; ++i) {
        watchdog.sign();
        now = now + 0.4;
    }
    EXPECT_EQ(fed, 16) << "400 seconds are four limits";
}

TEST_F(WatchdogTest, IsFedByOneOfManyThreadsThatGiveASignAtOnce) {
    Watchdog watchdog(loop, 100, world());
    now = 1030;
    std::vector<std::thread> threads;
    for (int i = 0; i < 8; ++i) threads.emplace_back([&] { watchdog.sign(); });
    for (std::thread& thread : threads) thread.join();
    EXPECT_EQ(fed, 2);
}

TEST_F(WatchdogTest, IsFedByALoopThatTurnsAndNotByOneThatIsStuck) {
    Watchdog watchdog(loop, 0.004, world());
    now = now + 1; // the loop does not turn, and nothing gives a sign
    EXPECT_EQ(fed, 1);
    ASSERT_TRUE(waitUntil(
        loop,
        [this] {
            now = now + 1;
            return fed >= 5;
        },
        "four more feeds"));
}

TEST_F(WatchdogTest, HearsNothingOfThreadsThatMustNotSpeakForTheWork) {
    int signs = 0;
    setSignOfLifeListener([&] { ++signs; });
    {
        const WithoutSignsOfLife silence;
        signOfLife();
        const WithoutSignsOfLife within;
        signOfLife();
    }
    EXPECT_EQ(signs, 0);
    signOfLife();
    EXPECT_EQ(signs, 1);
    setSignOfLifeListener([] {});
}

// The service manager's end of the socket.
class NotifySocket {
public:
    explicit NotifySocket(const std::string& path) : _fd(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0)) {
        sockaddr_un address{};
        address.sun_family = AF_UNIX;
        path.copy(address.sun_path, sizeof address.sun_path - 1);
        EXPECT_EQ(::bind(_fd, reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
        const timeval patience{60, 0};
        ::setsockopt(_fd, SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience);
    }
    ~NotifySocket() { ::close(_fd); }
    NotifySocket(const NotifySocket&) = delete;
    NotifySocket& operator=(const NotifySocket&) = delete;
    std::string next() const {
        char text[4096];
        const ssize_t n = ::recv(_fd, text, sizeof text, 0);
        return n > 0 ? std::string(text, static_cast<size_t>(n)) : "nothing came";
    }

private:
    int _fd;
};

TEST(WatchdogOfTheDaemon, IsFedWhileItWaitsForWork) {
    DaemonWorld world;
    const NotifySocket manager(world.home / "notify");
    world.home.setVariable("NOTIFY_SOCKET", world.home / "notify");
    world.home.setVariable("WATCHDOG_USEC", "40000");
    const auto daemon = world.serving();
    int feeds = 0;
    std::string told;
    for (bool ready = false; !ready || feeds < 5;) {
        told = manager.next();
        ready = ready || told == "READY=1";
        if (ready && told == "WATCHDOG=1") ++feeds;
        ASSERT_TRUE(told == "READY=1" || told == "WATCHDOG=1") << told;
    }
    EXPECT_TRUE(daemon->running());
}

TEST(WatchdogOfTheDaemon, IsLeftAloneWhereNobodyWatches) {
    DaemonWorld world;
    const NotifySocket manager(world.home / "notify");
    world.home.setVariable("NOTIFY_SOCKET", world.home / "notify");
    const auto daemon = world.serving();
    EXPECT_EQ(manager.next(), "READY=1");
    daemon->signal(SIGTERM);
    EXPECT_EQ(manager.next(), "STOPPING=1");
}

} // namespace
} // namespace rolvane::test
