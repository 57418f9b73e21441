#include "foundation/ConditionLock.h"

#include <atomic>
#include <chrono>
#include <limits>
#include <memory>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

using namespace rolvane;

namespace {
double secondsOf(const std::function<void()>& work) {
    auto start = std::chrono::steady_clock::now();
    work();
    return std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
}
} // namespace

TEST(ConditionLock, ItsConditionStaysWhenItIsUnlockedWithoutOne) {
    ConditionLock lock(3);
    EXPECT_EQ(lock.condition(), 3);
    lock.lock();
    lock.unlock();
    EXPECT_EQ(lock.condition(), 3);
    lock.lock();
    lock.unlockWithCondition(5);
    EXPECT_EQ(lock.condition(), 5);
}

TEST(ConditionLock, WaitingForAConditionThatDoesNotComeGivesUpWithoutTheLock) {
    ConditionLock lock(0);
    double took = secondsOf([&] { EXPECT_FALSE(lock.lockWhenCondition(1, 0.02)); });
    EXPECT_GE(took, 0.02);
    EXPECT_TRUE(lock.lockWhenCondition(0, 0)) << "the lock is free";
    lock.unlock();
}

TEST(ConditionLock, TheRightConditionIsNoUseWhileTheLockIsHeld) {
    ConditionLock lock(1);
    lock.lock();
    EXPECT_FALSE(lock.lockWhenCondition(1, 0.005));
    lock.unlock();
    EXPECT_TRUE(lock.lockWhenCondition(1, 0.005));
    lock.unlock();
}

TEST(ConditionLock, OddTimeoutsMeanTheNearestPossibleTime) {
    ConditionLock lock(0);
    EXPECT_FALSE(lock.lockWhenCondition(1, -1));
    EXPECT_FALSE(lock.lockWhenCondition(1, std::numeric_limits<double>::quiet_NaN()));
    EXPECT_TRUE(lock.lockWhenCondition(0, std::numeric_limits<double>::infinity()));
    lock.unlock();
}

TEST(ConditionLock, AThreadWaitsUntilAnotherSetsTheCondition) {
    ConditionLock lock(0);
    int shared = 0;
    std::thread other([&] {
        lock.lockWhenCondition(1);
        shared *= 2;
        lock.unlockWithCondition(2);
    });
    lock.lock();
    shared = 21;
    lock.unlockWithCondition(1);
    EXPECT_TRUE(lock.lockWhenCondition(2, 20));
    EXPECT_EQ(shared, 42);
    lock.unlock();
    other.join();
}

TEST(ConditionLock, OnlyOneThreadAtATimeIsInside) {
    ConditionLock lock;
    int inside = 0;
    bool crowded = false;
    std::vector<std::thread> threads;
    for (int t = 0; t < 8; ++t)
        threads.emplace_back([&] {
            for (int i = 0; i < 200; ++i) {
                lock.lock();
                crowded |= ++inside != 1;
                --inside;
                lock.unlockWithCondition(i);
            }
        });
    for (auto& thread : threads) thread.join();
    EXPECT_FALSE(crowded);
}

TEST(ConditionLock, ThreadsPassATokenRoundInTheOrderOfTheirConditions) {
    constexpr int kThreads = 5, kRounds = 20;
    ConditionLock lock(0);
    std::vector<int> order;
    std::vector<std::thread> threads;
    for (int t = 0; t < kThreads; ++t)
        threads.emplace_back([&, t] {
            for (int round = 0; round < kRounds; ++round) {
                lock.lockWhenCondition(t);
                order.push_back(t);
                lock.unlockWithCondition((t + 1) % kThreads);
            }
        });
    for (auto& thread : threads) thread.join();
    ASSERT_EQ(order.size(), size_t(kThreads * kRounds));
    for (size_t i = 0; i < order.size(); ++i) ASSERT_EQ(order[i], int(i % kThreads));
}

TEST(ConditionLock, TheOneWhoWaitedForTheEndMayDestroyTheLock) {
    for (int i = 0; i < 100; ++i) {
        auto lock = std::make_unique<ConditionLock>(0);
        std::thread worker([raw = lock.get()] {
            raw->lock();
            raw->unlockWithCondition(1);
        });
        lock->lockWhenCondition(1);
        lock->unlock();
        EXPECT_EQ(lock->condition(), 1);
        worker.join();
    }
}
