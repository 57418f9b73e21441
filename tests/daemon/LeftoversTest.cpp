#include "DaemonWorld.h"

#include "daemon/DaemonControl.h"

#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

namespace rolvane::test {
namespace {

namespace fs = std::filesystem;

void makeOld(const std::string& path) {
    const timespec times[2] = {{1'700'000'000, 0}, {1'700'000'000, 0}};
    ASSERT_EQ(::utimensat(AT_FDCWD, path.c_str(), times, 0), 0) << path;
}

// A datagram socket with a file; the caller closes it.
int socketAt(const std::string& path) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    path.copy(address.sun_path, sizeof address.sun_path - 1);
    const int fd = ::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    EXPECT_EQ(::bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof address), 0) << path;
    return fd;
}

TEST(Leftovers, OfKilledProcessesAreGoneWhenTheDaemonHasStarted) {
    DaemonWorld world;
    const std::string runtime = world.home / "runtime/rolvane/", locks = world.home / "state/rolvane/locks/";
    for (const std::string& directory : {runtime, locks}) fs::create_directories(directory);
    ::close(socketAt(runtime + "notify-dead"));
    ::close(socketAt(runtime + "notify-young"));
    const int alive = socketAt(runtime + "notify-alive");
    std::ofstream(locks + "0123456789abcdef.Ab12cd") << "1 1\n";
    std::ofstream(locks + "0123456789abcdef") << "1 1\nhttp://localhost/x\n\n";
    for (const std::string& path : {runtime + "notify-dead", runtime + "notify-alive",
                                    locks + "0123456789abcdef.Ab12cd", locks + "0123456789abcdef"})
        makeOld(path);
    const auto daemon = world.serving();
    EXPECT_FALSE(fs::exists(runtime + "notify-dead"));
    EXPECT_TRUE(fs::exists(runtime + "notify-young"));
    EXPECT_TRUE(fs::exists(runtime + "notify-alive"));
    EXPECT_FALSE(fs::exists(locks + "0123456789abcdef.Ab12cd"));
    EXPECT_TRUE(fs::exists(locks + "0123456789abcdef"));
    ::close(alive);
}

TEST(Leftovers, WhoWaitsForTheDaemonsStartHasNoFileThatCouldStay) {
    DaemonWorld world;
    DaemonControl::Options options;
    options.program = UserWorld::managerProgram();
    options.useServiceManager = false;
    const DaemonControl control(options);
    ASSERT_TRUE(control.start());
    size_t files = 0;
    for (const auto& each : fs::directory_iterator(world.home / "runtime/rolvane")) {
        EXPECT_TRUE(each.path().filename().string().starts_with("control-")) << each.path();
        ++files;
    }
    EXPECT_EQ(files, 1U);
    ASSERT_TRUE(control.stop());
    EXPECT_TRUE(fs::is_empty(world.home / "runtime/rolvane")) << "the socket goes with the daemon";
}

TEST(Leftovers, TheSocketOfAKilledDaemonIsReplacedByTheNext) {
    DaemonWorld world;
    const auto first = world.serving();
    first->kill();
    ASSERT_FALSE(fs::is_empty(world.home / "runtime/rolvane"));
    const auto second = world.serving();
    EXPECT_EQ(std::distance(fs::directory_iterator(world.home / "runtime/rolvane"), {}), 1);
    const Ran ran = world.rolvane({"daemon", "stop"});
    EXPECT_EQ(ran.status, 0) << ran;
}

} // namespace
} // namespace rolvane::test
