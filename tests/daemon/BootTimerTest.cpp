#include "daemon/BootTimer.h"

#include <ctime>
#include <gtest/gtest.h>

namespace rolvane::test {
namespace {

double secondsSinceBoot() {
    timespec now{};
    ::clock_gettime(CLOCK_BOOTTIME, &now);
    return static_cast<double>(now.tv_sec) + static_cast<double>(now.tv_nsec) * 1e-9;
}

TEST(BootTimerOfALoop, FiresOnceForAMomentThatIsOverAndForOneThatComes) {
    RunLoop loop;
    int fired = 0;
    BootTimer timer(loop, [&] { ++fired; });
    timer.set(secondsSinceBoot() - 100);
    loop.runOnce(30);
    EXPECT_EQ(fired, 1);
    loop.runOnce(0);
    EXPECT_EQ(fired, 1) << "once";
    const double due = secondsSinceBoot() + 0.05;
    timer.set(due);
    loop.runOnce(0);
    EXPECT_EQ(fired, 1) << "not before its time";
    loop.runOnce(30);
    EXPECT_EQ(fired, 2);
    EXPECT_GE(secondsSinceBoot(), due);
}

TEST(BootTimerOfALoop, FiresNotAtAllOnceItIsTakenBack) {
    RunLoop loop;
    int fired = 0;
    BootTimer timer(loop, [&] { ++fired; });
    timer.set(1); // a second after the start of the machine
    timer.set(std::nullopt);
    loop.runOnce(0);
    EXPECT_EQ(fired, 0);
}

TEST(SleepOfAMachine, IsToldWhenItLastedAndNotWhenTheClockWasSet) {
    RunLoop loop;
    int woken = 0;
    double slept = 1000; // before this program began
    SleepWatch watch(
        loop, [&] { ++woken; }, [&] { return slept; });
    watch.clockJumped(); // somebody has set the clock
    EXPECT_EQ(woken, 0);
    slept += 3; // connections outlive that
    watch.clockJumped();
    EXPECT_EQ(woken, 0);
    slept += 3600;
    watch.clockJumped();
    EXPECT_EQ(woken, 1);
    watch.clockJumped();
    EXPECT_EQ(woken, 1) << "each sleep once";
    slept += 4;
    watch.clockJumped();
    EXPECT_EQ(woken, 1) << "short ones do not add up";
}

TEST(SleepOfAMachine, OfThisOneIsNoLessThanNothing) {
    EXPECT_GE(SleepWatch::secondsSlept(), 0 - 1e-3);
}

} // namespace
} // namespace rolvane::test
