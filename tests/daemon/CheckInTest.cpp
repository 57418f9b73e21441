#include "DaemonWorld.h"

#include "daemon/CheckIn.h"
#include "foundation/Date.h"
#include "foundation/Paths.h"

#include <csignal>
#include <cstring>
#include <fcntl.h>
#include <fstream>
#include <netinet/in.h>
#include <poll.h>
#include <sstream>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

namespace rolvane::test {
namespace {

class Socket {
public:
    explicit Socket(int fd) : _fd(fd) {}
    ~Socket() {
        if (_fd >= 0) ::close(_fd);
    }
    Socket(const Socket&) = delete;
    Socket& operator=(const Socket&) = delete;
    int get() const { return _fd; }
    // The other side has taken everything and closed.
    bool endsWithin(double seconds) const {
        pollfd ready{_fd, POLLIN, 0};
        char byte = 0;
        return ::poll(&ready, 1, static_cast<int>(seconds * 1000)) == 1 && ::recv(_fd, &byte, 1, 0) <= 0;
    }

private:
    int _fd;
};

sockaddr_un addressOf(const std::string& path) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
    return address;
}

bool sends(const Socket& socket, const std::string& path, const std::string& text) {
    const sockaddr_un address = addressOf(path);
    if (::connect(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) return false;
    return ::send(socket.get(), text.data(), text.size(), MSG_NOSIGNAL) == static_cast<ssize_t>(text.size());
}

// Processor time that the process has used, in clock ticks.
long ticksOf(pid_t pid) {
    std::ifstream file("/proc/" + std::to_string(pid) + "/stat");
    std::string text((std::istreambuf_iterator<char>(file)), {});
    std::istringstream fields(text.substr(text.rfind(')') + 2));
    std::string skipped;
    for (int i = 0; i < 11; ++i) fields >> skipped;
    long user = 0, system = 0;
    fields >> user >> system;
    return user + system;
}

class CheckIn : public testing::Test {
protected:
    // The launcher with the daemon behind a socket at `path`.
    std::unique_ptr<ChildProcess> launcher(const std::string& path) {
        std::vector<std::string> arguments{"systemd-socket-activate", "--listen=" + path};
        for (const char* name : {"HOME", "XDG_DATA_HOME", "XDG_STATE_HOME", "XDG_CACHE_HOME", "XDG_CONFIG_HOME",
                                 "XDG_RUNTIME_DIR", "ROLVANE_LOG"})
            arguments.push_back(std::string("--setenv=") + name);
        arguments.push_back(UserWorld::managerProgram());
        world.setDebugLevel(1);
        auto started = std::make_unique<ChildProcess>(
            ChildProcess::Options{.arguments = arguments, .environment = world.home.environment()});
        EXPECT_TRUE(started->waitForLine("Listening on")) << started->errors();
        return started;
    }
    // The daemon with a descriptor of the test's as the one that the launcher passes.
    std::unique_ptr<ChildProcess> startedWith(int fd) {
        world.setDebugLevel(1);
        return std::make_unique<ChildProcess>(ChildProcess::Options{
            .arguments = {"/bin/sh", "-c", "LISTEN_FDS=1 LISTEN_PID=$$ exec \"$0\"", UserWorld::managerProgram()},
            .environment = world.home.environment(),
            .descriptors = {{fd, 3}}});
    }
    DaemonWorld world;
};

TEST_F(CheckIn, TheLauncherStartsItWithTheFirstConnection) {
    const std::string path = world.home / "activation";
    const auto process = launcher(path);
    EXPECT_FALSE(world.daemon());
    const Socket client(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    ASSERT_TRUE(sends(client, path, "wake up"));
    ASSERT_TRUE(process->waitForLine(kServing)) << process->errors();
    EXPECT_EQ(world.daemon(), process->pid());
}

TEST_F(CheckIn, TheLaunchersMessagesAreDrained) {
    const std::string path = world.home / "activation";
    const auto process = launcher(path);
    for (int message = 0; message < 3; ++message) {
        const Socket client(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
        ASSERT_TRUE(sends(client, path, std::string(10'000, 'x')));
        EXPECT_TRUE(client.endsWithin(20)) << "message " << message << " was not taken\n" << process->errors();
    }
    EXPECT_TRUE(process->running());
}

TEST_F(CheckIn, ADatagramSocketIsDrainedToo) {
    const std::string path = world.home / "datagrams";
    const Socket server(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
    const sockaddr_un address = addressOf(path);
    ASSERT_EQ(::bind(server.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
    const auto process = startedWith(server.get());
    ASSERT_TRUE(process->waitForLine(kServing)) << process->errors();
    // More than the socket holds at a time: sending waits for the daemon to take some.
    const Socket client(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
    const timeval patience{20, 0};
    ::setsockopt(client.get(), SOL_SOCKET, SO_SNDTIMEO, &patience, sizeof patience);
    ASSERT_TRUE(sends(client, path, "first"));
    constexpr int kMessages = 2000;
    for (int i = 0; i < kMessages; ++i) ASSERT_EQ(::send(client.get(), "again", 5, MSG_NOSIGNAL), 5) << "message " << i;
}

TEST_F(CheckIn, WhatCannotBeWatchedIsIgnoredSilently) {
    const Socket nothing(::open("/dev/null", O_RDWR | O_CLOEXEC));
    const auto process = startedWith(nothing.get());
    ASSERT_TRUE(process->waitForLine(kServing)) << process->errors();
    EXPECT_FALSE(process->wait(0.2)) << process->errors();
    EXPECT_EQ(linesWith(process->errors(), "xception"), 0U) << process->errors();
}

// A descriptor whose owner still uses it: nothing of it is read, and no flag of it is changed.
class ForeignDescriptor : public CheckIn, public testing::WithParamInterface<const char*> {
protected:
    // A socket that is foreign to the user, and how somebody sends to it.
    static int networkListener() {
        const int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
        sockaddr_in address{};
        address.sin_family = AF_INET;
        address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        EXPECT_EQ(::bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
        EXPECT_EQ(::listen(fd, 5), 0);
        return fd;
    }
    static int networkDatagrams() {
        const int fd = ::socket(AF_INET6, SOCK_DGRAM | SOCK_CLOEXEC, 0);
        return fd >= 0 ? fd : ::socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    }
    static int abstractListener() {
        const int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
        sockaddr_un address{};
        address.sun_family = AF_UNIX; // the kernel finds a name
        EXPECT_EQ(::bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof address.sun_family), 0);
        EXPECT_EQ(::listen(fd, 5), 0);
        return fd;
    }
    // Its path has been taken by something else since.
    int movedListener() {
        const std::string path = world.home / "moved";
        const int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
        const sockaddr_un address = addressOf(path);
        EXPECT_EQ(::bind(fd, reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
        EXPECT_EQ(::listen(fd, 5), 0);
        ::unlink(path.c_str());
        std::ofstream(path) << "a file\n";
        return fd;
    }
    static int pipeToWriteTo() {
        int ends[2];
        EXPECT_EQ(::pipe2(ends, O_CLOEXEC), 0);
        ::close(ends[0]);
        return ends[1];
    }
    int make() {
        const std::string kind = GetParam();
        return kind == "NetworkListener"    ? networkListener()
               : kind == "NetworkDatagrams" ? networkDatagrams()
               : kind == "AbstractListener" ? abstractListener()
               : kind == "MovedListener"    ? movedListener()
                                            : pipeToWriteTo();
    }
};

TEST_P(ForeignDescriptor, IsLeftAlone) {
    const Socket foreign(make());
    const int flags = ::fcntl(foreign.get(), F_GETFL);
    const auto process = startedWith(foreign.get());
    ASSERT_TRUE(process->waitForLine(kServing)) << process->errors();
    EXPECT_EQ(linesWith(process->errors(), "is left alone"), 1U) << process->errors();
    EXPECT_EQ(::fcntl(foreign.get(), F_GETFL), flags);
}

INSTANTIATE_TEST_SUITE_P(Each, ForeignDescriptor,
                         testing::Values("NetworkListener", "NetworkDatagrams", "AbstractListener", "MovedListener",
                                         "PipeToWriteTo"),
                         [](const auto& kind) { return std::string(kind.param); });

TEST_F(CheckIn, APeerThatHasClosedIsForgottenAndCostsNothing) {
    int ends[2];
    ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends), 0);
    auto peer = std::make_unique<Socket>(ends[0]);
    std::unique_ptr<ChildProcess> process;
    {
        const Socket passed(ends[1]);
        process = startedWith(passed.get());
    }
    ASSERT_TRUE(process->waitForLine(kServing)) << process->errors();
    peer.reset();
    const long before = ticksOf(process->pid());
    EXPECT_FALSE(process->wait(0.4)) << process->errors();
    EXPECT_LT(ticksOf(process->pid()) - before, ::sysconf(_SC_CLK_TCK) / 10) << "it spins";
}

TEST_F(CheckIn, ItTellsTheLauncherThatItIsReady) {
    const std::string path = world.home / "notify";
    const Socket server(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
    const sockaddr_un address = addressOf(path);
    ASSERT_EQ(::bind(server.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
    world.home.setVariable("NOTIFY_SOCKET", path);
    const auto process = world.startManager();
    pollfd ready{server.get(), POLLIN, 0};
    ASSERT_EQ(::poll(&ready, 1, 20'000), 1) << process->errors();
    char text[256] = {};
    ASSERT_GT(::recv(server.get(), text, sizeof text - 1, 0), 0);
    EXPECT_NE(std::string(text).find("READY=1"), std::string::npos) << text;
}

TEST_F(CheckIn, WithoutALauncherTheLoopStillHasSomethingToWaitFor) {
    RunLoop loop;
    const CheckInPorts ports = CXDCheckIn(loop);
    EXPECT_FALSE(ports.fromLauncher());
    const Clock& clock = Clock::system();
    constexpr double kSeconds = 0.05;
    const Date began = clock.now();
    loop.runUntil(Date(began.secondsSince1970() + kSeconds));
    EXPECT_GE(clock.now().secondsSince1970() - began.secondsSince1970(), kSeconds * 0.9);
}

} // namespace
} // namespace rolvane::test
