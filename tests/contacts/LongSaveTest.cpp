// A save that takes long, and those who save meanwhile.

#include "TestDatabase.h"

#include <atomic>
#include <chrono>
#include <thread>

namespace rolvane::test {
namespace {

using Seconds = std::chrono::duration<double>;

double secondsOf(const std::function<void()>& action) {
    const auto start = std::chrono::steady_clock::now();
    action();
    return Seconds(std::chrono::steady_clock::now() - start).count();
}

// One save takes everything away that came by a subscription: nobody may ever see a part of it gone. Another program
// waits for it, as long as its timeout allows, and loses nothing.
TEST(LongSave, OfManyRemovalsIsWaitedForByOtherProgramsAndNoneOfThemFails) {
    constexpr int kCopies = 5000;
    const std::string location = "http://store.example/bob/Contacts";
    TestDatabase test;
    CXSubscriptionRef subscription = CXSubscription::create(RemoteLocation(location));
    test->addRecord(subscription);
    for (int i = 0; i < kCopies; ++i) test.addSubscribedPerson("Copy " + std::to_string(i), location);
    test->save();
    ASSERT_EQ(test->countPeople(RemoteLocation(location)), static_cast<size_t>(kCopies));

    std::atomic<bool> begun = false, ended = false;
    size_t saves = 0, partlyGone = 0;
    double longest = 0;
    std::string failure;
    std::thread other([&] {
        try {
            CXRolvane::Options options = test.options("rolvane");
            options.busyTimeoutMilliseconds = 60000; // a machine may be slow, and a sanitizer is
            const auto theirs = std::make_unique<CXRolvane>(options);
            begun = true;
            for (bool last = false; !last; ++saves) {
                last = ended;
                TestDatabase::addPersonTo(*theirs, "Own " + std::to_string(saves));
                longest = std::max(longest, secondsOf([&] { theirs->save(); }));
                const size_t left = theirs->countPeople(RemoteLocation(location));
                partlyGone += left != 0 && left != static_cast<size_t>(kCopies);
            }
        } catch (const std::exception& e) {
            failure = e.what();
            begun = true;
        }
    });
    while (!begun) std::this_thread::yield();
    test->removeRecord(subscription);
    const double removal = secondsOf([&] { test->save(); });
    ended = true;
    other.join();

    EXPECT_EQ(failure, "");
    EXPECT_EQ(partlyGone, 0u);
    EXPECT_EQ(test->countPeople(RemoteLocation(location)), 0u);
    EXPECT_EQ(test->countPeople(RemoteLocation()), saves);
    RecordProperty("removalMilliseconds", static_cast<int>(removal * 1000));
    RecordProperty("longestWaitMilliseconds", static_cast<int>(longest * 1000));
}

} // namespace
} // namespace rolvane::test
