#include "foundation/TemporaryFiles.h"

#include "foundation/Paths.h"
#include "support/TempHome.h"

#include <csignal>
#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <sys/file.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

using namespace rolvane;
using namespace rolvane::test;

namespace {

struct TemporaryFiles : testing::Test {
    TempDirectory directory;
    std::string make(const std::string& name, bool old = true) {
        const std::string path = directory / name;
        std::ofstream(path) << "half of it";
        const timespec times[2] = {{1'700'000'000, 0}, {1'700'000'000, 0}};
        if (old) {
            EXPECT_EQ(::utimensat(AT_FDCWD, path.c_str(), times, 0), 0);
        }
        return path;
    }
    bool isThere(const std::string& path) { return std::filesystem::exists(path); }
    size_t sweep() { return removeLeftTemporaryFiles(directory.path()); }
};

} // namespace

TEST_F(TemporaryFiles, OfKilledProcessesGoAndNothingElseDoes) {
    const std::vector<std::string> gone = {make("account.plist.writing-aB3dE9"), make("0123456789abcdef.Zz09aA"),
                                           make("0B9A7C1E-1111-4222-8333-444455556666.abcdef")};
    const std::vector<std::string> stay = {make("account.plist"),           make("notes.backup"),
                                           make("contacts.db.backup"),      make("0123456789abcdef"),
                                           make("account.plist.writing-"),  make("account.plist.writing-aB3-E9"),
                                           make("0123456789abcdeg.abcdef"), make("fresh.writing-aB3dE9", false)};
    EXPECT_EQ(sweep(), gone.size());
    for (const std::string& path : gone) EXPECT_FALSE(isThere(path)) << path;
    for (const std::string& path : stay) EXPECT_TRUE(isThere(path)) << path;
    EXPECT_EQ(removeLeftTemporaryFiles(directory / "missing"), 0U);
}

TEST_F(TemporaryFiles, OneThatIsBeingWrittenStaysHoweverLongItTakes) {
    const std::string path = make("large.writing-aB3dE9");
    const int writer = ::open(path.c_str(), O_WRONLY | O_CLOEXEC);
    ASSERT_EQ(::flock(writer, LOCK_EX), 0);
    EXPECT_EQ(sweep(), 0U);
    ::close(writer);
    EXPECT_EQ(sweep(), 1U);
}

TEST_F(TemporaryFiles, LinksAndDirectoriesOfSuchNamesStay) {
    const std::string target = make("target");
    std::filesystem::create_symlink(target, directory / "link.writing-aB3dE9");
    std::filesystem::create_directory(directory / "directory.writing-aB3dE9");
    EXPECT_EQ(sweep(), 0U);
    EXPECT_TRUE(isThere(target));
}

// While one process writes files, another one clears up without a pause: no write fails.
TEST_F(TemporaryFiles, NoWriteFailsBesideSomebodyWhoClearsUp) {
    const pid_t sweeper = ::fork();
    if (sweeper == 0)
        for (;;) removeLeftTemporaryFiles(directory.path());
    for (int i = 0; i < 2000; ++i) EXPECT_NO_THROW(writeFileWhole(directory / "file", std::to_string(i)));
    ::kill(sweeper, SIGKILL);
    ASSERT_EQ(::waitpid(sweeper, nullptr, 0), sweeper);
    EXPECT_EQ(readFile(directory / "file"), "1999");
    EXPECT_EQ(std::distance(std::filesystem::directory_iterator(directory.path()), {}), 1);
}
