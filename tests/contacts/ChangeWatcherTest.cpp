#include "contacts/database/ChangeWatcher.h"

#include "support/CapturingLog.h"
#include "support/TempHome.h"
#include "support/WaitUntil.h"
#include "support/WithoutInotify.h"

#include <fstream>
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <unistd.h>

namespace rolvane {
namespace {

using namespace test;

// A database's directory, and how often a watcher has called.
struct Watched {
    TempDirectory directory;
    std::string path = directory / "contacts.db";
    RunLoop loop;
    int calls = 0;

    Watched() { write(path, "a database"); }
    std::unique_ptr<ChangeWatcher> watcher() {
        return std::make_unique<ChangeWatcher>(loop, nullptr, path, [this] { ++calls; });
    }
    static void write(const std::string& file, const std::string& text) { std::ofstream(file, std::ios::app) << text; }
    testing::AssertionResult isCalled(const std::string& what) {
        const int before = calls;
        return waitUntil(
            loop, [&] { return calls > before; }, what);
    }
};

// Every process of a user takes one watch, and there are 128 for all of them.
TEST(ChangeWatcher, LooksByItselfWhereThereIsNoWatchAndSaysSoOnce) {
    withoutInotify([] {
        const CapturingLog log;
        Watched watched;
        const auto watcher = watched.watcher();
        const auto another = watched.watcher();
        ChangeWatcher::touch(watched.path);
        EXPECT_TRUE(watched.isCalled("a save"));
        Watched::write(watched.path + "-wal", "a transaction");
        EXPECT_TRUE(watched.isCalled("a saver that died before the touch"));
        Watched::write(watched.path + "-new", "a backup that is put back");
        ASSERT_EQ(::rename((watched.path + "-new").c_str(), watched.path.c_str()), 0);
        EXPECT_TRUE(watched.isCalled("another file"));
        const auto lines = log.lines();
        EXPECT_EQ(std::count_if(lines.begin(), lines.end(),
                                [](const std::string& line) { return line.find("inotify") != std::string::npos; }),
                  1)
            << log.text();
    });
}

TEST(ChangeWatcher, WatchesAgainWhenThereIsAWatch) {
    Watched watched;
    const auto first = watched.loop.scheduleTimer(1000, [] {}); // the loop's own descriptor for timers
    rlimit limit{};
    ASSERT_EQ(getrlimit(RLIMIT_NOFILE, &limit), 0);
    const rlimit none{0, limit.rlim_max}; // no descriptor more
    ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &none), 0);
    const auto watcher = watched.watcher();
    ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &limit), 0);
    ChangeWatcher::touch(watched.path);
    EXPECT_TRUE(watched.isCalled("a save in between"));
    ChangeWatcher::touch(watched.path);
    EXPECT_TRUE(watched.isCalled("a save behind it"));
}

} // namespace
} // namespace rolvane
