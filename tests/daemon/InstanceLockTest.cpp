#include "daemon/InstanceLock.h"

#include "foundation/CXException.h"
#include "support/ChildProcess.h"
#include "support/TempHome.h"

#include <fcntl.h>
#include <fstream>
#include <future>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

namespace rolvane {
namespace {

using test::TempDirectory;

class InstanceLockOf : public testing::Test {
protected:
    TempDirectory directory;
    const std::string path = directory / "lock";
};

TEST_F(InstanceLockOf, ASecondTakerGetsNothingUntilTheFirstHasLetGo) {
    auto first = InstanceLock::acquire(path);
    ASSERT_TRUE(first);
    EXPECT_FALSE(InstanceLock::acquire(path));
    first.reset();
    EXPECT_TRUE(InstanceLock::acquire(path));
}

TEST_F(InstanceLockOf, TheHolderIsNamedAndNobodyElse) {
    EXPECT_FALSE(InstanceLock::holder(path)) << "there is no file";
    {
        const auto lock = InstanceLock::acquire(path);
        EXPECT_EQ(InstanceLock::holder(path), ::getpid());
    }
    EXPECT_FALSE(InstanceLock::holder(path)) << "the number is in the file, but nobody holds it";
}

TEST_F(InstanceLockOf, AskingForTheHolderDoesNotTakeTheLockAway) {
    const auto lock = InstanceLock::acquire(path);
    for (int i = 0; i < 3; ++i) EXPECT_EQ(InstanceLock::holder(path), ::getpid());
    EXPECT_FALSE(InstanceLock::acquire(path));
}

TEST_F(InstanceLockOf, AFileThatAnEarlierProcessLeftBehindIsNoObstacle) {
    std::ofstream(path) << "1\n";
    EXPECT_FALSE(InstanceLock::holder(path));
    const auto lock = InstanceLock::acquire(path);
    ASSERT_TRUE(lock);
    EXPECT_EQ(InstanceLock::holder(path), ::getpid());
}

// Between the two of them the number is still that of an earlier process.
TEST_F(InstanceLockOf, AHolderThatHasNotPutDownItsNumberYetIsWaitedFor) {
    std::ofstream(path) << "1\n";
    const int fd = ::open(path.c_str(), O_RDWR | O_CLOEXEC);
    const auto lockByte = [&](off_t byte) {
        struct flock lock = {};
        lock.l_type = F_WRLCK;
        lock.l_whence = SEEK_SET;
        lock.l_start = byte;
        lock.l_len = 1;
        return ::fcntl(fd, F_OFD_SETLK, &lock) == 0;
    };
    ASSERT_TRUE(lockByte(0));
    EXPECT_FALSE(InstanceLock::acquire(path));
    auto asked = std::async(std::launch::async, [&] { return InstanceLock::holder(path); });
    EXPECT_EQ(asked.wait_for(std::chrono::milliseconds(20)), std::future_status::timeout);
    std::ofstream(path) << "4711\n";
    ASSERT_TRUE(lockByte(1));
    EXPECT_EQ(asked.get(), 4711);
    ::close(fd);
}

TEST_F(InstanceLockOf, MovingKeepsIt) {
    auto lock = InstanceLock::acquire(path);
    const InstanceLock moved(std::move(*lock));
    lock.reset();
    EXPECT_FALSE(InstanceLock::acquire(path));
}

TEST_F(InstanceLockOf, AChildThatIsStartedMeanwhileDoesNotInheritIt) {
    auto lock = InstanceLock::acquire(path);
    test::ChildProcess child({"/bin/cat"}); // waits for its input
    lock.reset();
    EXPECT_TRUE(InstanceLock::acquire(path));
}

TEST_F(InstanceLockOf, APlaceThatCannotHoldItIsNamed) {
    const std::string impossible = directory / "missing/lock";
    try {
        (void)InstanceLock::acquire(impossible);
        FAIL() << "there is no such directory";
    } catch (const CXException& exception) {
        EXPECT_NE(exception.reason().find(impossible), std::string::npos) << exception.reason();
    }
}

TEST_F(InstanceLockOf, TheFileIsForItsOwnerOnly) {
    const mode_t former = ::umask(0);
    const auto lock = InstanceLock::acquire(path);
    ::umask(former);
    struct stat status = {};
    ASSERT_EQ(::stat(path.c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 0777U, 0600U);
}

} // namespace
} // namespace rolvane
