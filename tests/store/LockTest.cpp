#include "StoreWorld.h"
#include "foundation/Paths.h"
#include "store/locks/CXWebDAVLock.h"
#include "store/locks/StoreLock.h"
#include "support/ChildProcess.h"

#include <chrono>
#include <filesystem>
#include <fstream>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <set>
#include <sstream>
#include <sys/wait.h>
#include <unistd.h>

namespace rolvane {
namespace {

using namespace test;

constexpr char kEndedRun[] = "4194305 0"; // above the highest process id that there can be (2^22)

class Locks : public testing::Test {
protected:
    void SetUp() override { ASSERT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true)); }
    std::shared_ptr<CXWebDAVLock> lock(Client& client) { return makeStoreLock(client.manager, client.at("dateFile")); }

    StoreWorld world;
    Client alice{world};
    Client second{world};
};

TEST_F(Locks, ALockIsTakenByOneClientAtATime) {
    auto mine = lock(alice), theirs = lock(second);
    EXPECT_FALSE(mine->locked());
    ASSERT_TRUE(mine->tryLock());
    EXPECT_TRUE(mine->locked());
    EXPECT_NEAR(mine->expires().secondsSince(Clock::system().now()), CXWebDAVLock::lockTimeout(), 5);
    EXPECT_FALSE(theirs->tryLock());
    EXPECT_FALSE(theirs->locked());
    mine->unlock();
    EXPECT_FALSE(mine->locked());
    EXPECT_TRUE(theirs->tryLock());
    theirs->unlock();
}

TEST_F(Locks, TakingAHeldLockAgainAsksNobody) {
    auto mine = lock(alice);
    ASSERT_TRUE(mine->tryLock());
    alice.wire->clear();
    EXPECT_TRUE(mine->tryLock());
    EXPECT_EQ(alice.wire->methods(), "");
    mine->unlock();
    EXPECT_EQ(alice.wire->methods(), "UNLOCK");
    mine->unlock();
    EXPECT_EQ(alice.wire->methods(), "UNLOCK");
}

TEST_F(Locks, TheHolderWritesTheLockedFileAndOthersDoNot) {
    auto mine = lock(alice);
    ASSERT_TRUE(mine->tryLock());
    EXPECT_EQ(alice.write("dateFile", "why"), 204);
    EXPECT_EQ(second.write("dateFile", "who"), 423);
    EXPECT_EQ(second.write("People/1/A:CXPerson", "free"), 201) << "only the clock file is locked";
    mine->unlock();
    EXPECT_EQ(second.write("dateFile", "why"), 204);
}

TEST_F(Locks, ARenewedLockExpiresLaterAndStaysHeld) {
    auto mine = lock(alice);
    ASSERT_TRUE(mine->tryLock());
    const Date before = mine->expires();
    EXPECT_TRUE(mine->renew());
    EXPECT_GE(mine->expires().secondsSince(before), -1) << "the store tells whole seconds that are left";
    EXPECT_FALSE(lock(second)->tryLock());
    mine->unlock();
}

TEST_F(Locks, ALockThatTheStoreForgotIsLostAtItsRenewal) {
    auto mine = lock(alice);
    ASSERT_TRUE(mine->tryLock());
    for (const auto& e : alice.wire->exchanges()) ASSERT_NE(e.status, 0);
    int code = 0;
    ASSERT_TRUE(alice.manager.removeFileAtURL(alice.at("dateFile"), &code)) << code; // takes the lock with it
    EXPECT_FALSE(mine->renew());
    EXPECT_FALSE(mine->locked());
    EXPECT_EQ(alice.write("dateFile", "why"), 201) << "the lost token is not sent any more";
}

TEST_F(Locks, ALockOfARunThatWasKilledIsTakenOverAndOnesOfLivingRunsAreNot) {
    auto mine = lock(alice);
    ASSERT_TRUE(mine->tryLock());
    EXPECT_FALSE(lock(second)->tryLock()) << "the holder lives";
    // The note that a run with another process leaves behind when it is killed.
    std::filesystem::path note;
    for (const auto& e : std::filesystem::directory_iterator(stateDirectory() + "/locks")) note = e.path();
    std::string text = readFile(note);
    writeFileDurably(note, std::string(kEndedRun) + text.substr(text.find('\n')));
    auto next = lock(second);
    EXPECT_TRUE(next->tryLock());
    EXPECT_EQ(second.write("dateFile", "why"), 204);
    next->unlock();
    EXPECT_FALSE(mine->renew());
}

// The answer to its LOCK came too late for it, so the token stands nowhere but on the store.
TEST_F(Locks, ALockOfARunThatWasKilledBeforeItHeardOfItIsTakenOver) {
    ASSERT_TRUE(lock(alice)->tryLock());
    std::filesystem::remove_all(stateDirectory() + "/locks");
    alice.wire->clear();
    EXPECT_FALSE(lock(second)->tryLock()) << "its run is this process";
    for (const auto& run : std::filesystem::directory_iterator(stateDirectory() + "/locks-runs"))
        writeFileDurably(run.path(), kEndedRun);
    auto next = lock(second);
    EXPECT_TRUE(next->tryLock());
    EXPECT_EQ(second.write("dateFile", "why"), 204);
    next->unlock();
}

// As if another process had made them.
void giveLocksOfThisProcessTo(const std::string& process, bool knowsItsTokens = true) {
    for (const auto& run : std::filesystem::directory_iterator(stateDirectory() + "/locks-runs"))
        writeFileDurably(run.path(), process);
    for (const auto& note : std::filesystem::directory_iterator(stateDirectory() + "/locks")) {
        std::string text = readFile(note.path());
        text.replace(0, text.find('\n'), process);
        if (!knowsItsTokens) text.replace(text.rfind('\n', text.size() - 2), std::string::npos, "\n\n");
        writeFileDurably(note.path(), text);
    }
}

// The process id and when it was started, in the kernel's ticks; "" when there is no such process.
std::string processLine(pid_t pid) {
    std::ifstream stat("/proc/" + std::to_string(pid) + "/stat");
    const std::string text((std::istreambuf_iterator<char>(stat)), {});
    if (text.empty()) return {};
    std::istringstream fields(text.substr(text.rfind(')') + 2)); // from field 3 on
    std::string field;
    for (int i = 3; i <= 22; ++i) fields >> field;
    return std::to_string(pid) + " " + field;
}

TEST_F(Locks, WhatKilledRunsHoldIsGivenBackWhetherTheyKnewTheirTokenOrNot) {
    for (const bool knewItsToken : {true, false}) {
        ASSERT_TRUE(lock(alice)->tryLock());
        giveLocksOfThisProcessTo(kEndedRun, knewItsToken);
        EXPECT_EQ(second.write("dateFile", "who"), 423);
        releaseLocksOfEndedRuns(second.manager);
        EXPECT_EQ(second.write("dateFile", "who"), 204) << second.wire->text();
        EXPECT_TRUE(std::filesystem::is_empty(stateDirectory() + "/locks"));
        second.wire->clear();
        releaseLocksOfEndedRuns(second.manager);
        EXPECT_EQ(second.wire->methods(), "") << "nothing is known of any more";
    }
}

// The release was carried out and its answer lost. httpd refuses a second one with 400.
TEST_F(Locks, ALockThatIsGoneAlreadyIsNotedNoLonger) {
    auto mine = lock(alice);
    ASSERT_TRUE(mine->tryLock());
    const std::string note = stateDirectory() + "/locks-of-this-test";
    std::filesystem::copy(stateDirectory() + "/locks", note);
    mine->unlock();
    std::filesystem::remove_all(stateDirectory() + "/locks");
    std::filesystem::rename(note, stateDirectory() + "/locks");
    giveLocksOfThisProcessTo(kEndedRun);
    releaseLocksOfEndedRuns(second.manager);
    EXPECT_TRUE(std::filesystem::is_empty(stateDirectory() + "/locks")) << second.wire->text();
    second.wire->clear();
    releaseLocksOfEndedRuns(second.manager);
    EXPECT_EQ(second.wire->methods(), "") << "nothing is known of any more";
}

// The kernel's tables still name it, and nobody knows for how long: that is up to its parent.
TEST_F(Locks, AKilledRunThatItsParentHasNotWaitedForHoldsNothingAnyMore) {
    ChildProcess run(std::vector<std::string>{"sleep", "60"});
    ASSERT_TRUE(lock(alice)->tryLock());
    giveLocksOfThisProcessTo(processLine(run.pid()));
    releaseLocksOfEndedRuns(second.manager);
    EXPECT_EQ(second.write("dateFile", "who"), 423) << "it lives";
    run.signal(SIGKILL);
    siginfo_t ended{};
    ASSERT_EQ(::waitid(P_PID, static_cast<id_t>(run.pid()), &ended, WEXITED | WNOWAIT), 0);
    ASSERT_NE(processLine(run.pid()), "");
    releaseLocksOfEndedRuns(second.manager);
    EXPECT_EQ(second.write("dateFile", "who"), 204);
}

TEST_F(Locks, WhatLivingRunsHoldIsLeftToThem) {
    auto mine = lock(alice);
    ASSERT_TRUE(mine->tryLock());
    second.wire->clear();
    releaseLocksOfEndedRuns(second.manager);
    EXPECT_EQ(second.wire->methods(), "");
    EXPECT_TRUE(mine->renew());
    mine->unlock();
}

TEST_F(Locks, ALockThatCouldNotBeGivenBackIsGivenBackAnotherTime) {
    for (const bool knewItsToken : {true, false}) {
        ASSERT_TRUE(lock(alice)->tryLock());
        giveLocksOfThisProcessTo(kEndedRun, knewItsToken);
        HttpResponse lost;
        lost.error = TransportError::unreachable;
        second.wire->intercept([&](const HttpRequest&) { return std::optional(lost); });
        releaseLocksOfEndedRuns(second.manager);
        second.wire->intercept(nullptr);
        EXPECT_EQ(second.write("dateFile", "who"), 423);
        releaseLocksOfEndedRuns(second.manager);
        EXPECT_EQ(second.write("dateFile", "who"), 204);
    }
}

TEST_F(Locks, AnAskedLockIsNotedBeforeItIsHadAndARefusedOneIsStruck) {
    bool noted = false;
    alice.wire->intercept([&](const HttpRequest& request) -> std::optional<HttpResponse> {
        if (request.method == "LOCK") noted = !std::filesystem::is_empty(stateDirectory() + "/locks");
        return std::nullopt;
    });
    auto mine = lock(alice);
    ASSERT_TRUE(mine->tryLock());
    EXPECT_TRUE(noted);
    const std::string note = readFile(std::filesystem::directory_iterator(stateDirectory() + "/locks")->path());
    EXPECT_FALSE(lock(second)->tryLock());
    EXPECT_EQ(readFile(std::filesystem::directory_iterator(stateDirectory() + "/locks")->path()), note)
        << "the holder's stays";
    mine->unlock();
    EXPECT_TRUE(std::filesystem::is_empty(stateDirectory() + "/locks"));
}

TEST_F(Locks, OldRunsAreForgottenAndWhatElseLiesThereIsNoHindrance) {
    const std::filesystem::path runs = stateDirectory() + "/locks-runs";
    std::filesystem::create_directories(runs / "a directory");
    writeFileDurably(runs / "ended", kEndedRun);
    writeFileDurably(runs / "recent", kEndedRun);
    const auto longAgo = std::filesystem::file_time_type::clock::now() - std::chrono::hours(24);
    for (const char* old : {"a directory", "ended"}) std::filesystem::last_write_time(runs / old, longAgo);
    auto mine = lock(alice);
    ASSERT_TRUE(mine->tryLock());
    std::set<std::string> left;
    for (const auto& run : std::filesystem::directory_iterator(runs)) left.insert(run.path().filename());
    EXPECT_THAT(left, testing::IsSupersetOf({"a directory", "recent"}));
    EXPECT_FALSE(left.contains("ended"));
    EXPECT_EQ(left.size(), 3u) << "and this run's";
    mine->unlock();
}

TEST_F(Locks, ALockOfAnotherInstallationOrAnotherProgramIsNotTakenOver) {
    ASSERT_TRUE(lock(alice)->tryLock());
    for (const char* directory : {"/locks", "/locks-runs"}) std::filesystem::remove_all(stateDirectory() + directory);
    EXPECT_FALSE(lock(second)->tryLock()) << "nothing is known here of the run that it names";
}

// Its end would be minutes away, and every pass until then would find its own lock in its way.
TEST_F(Locks, ALockWhoseReleaseOrRenewalWasNotHeardOfIsTakenOverByTheSameClient) {
    HttpResponse lost;
    lost.error = TransportError::unreachable;
    const HttpResponse redirect = answerOf(302, {{"location", "http://portal.example/"}}, "<html/>");
    for (const auto& [renewed, answer] : {std::pair(false, lost),
                                          {true, lost},
                                          {false, answerOf(503)},
                                          {false, redirect},
                                          {true, redirect},
                                          {false, answerOf(403)},
                                          {true, answerOf(403)},
                                          {true, answerOf(200)},
                                          {false, answerOf(423)}}) {
        auto mine = lock(alice);
        ASSERT_TRUE(mine->tryLock());
        alice.wire->intercept([given = answer](const HttpRequest&) { return std::optional(given); });
        renewed ? void(mine->renew()) : mine->unlock();
        alice.wire->intercept(nullptr);
        EXPECT_FALSE(mine->locked());
        EXPECT_FALSE(lock(second)->tryLock()) << "another client's object of the same process";
        auto next = lock(alice);
        EXPECT_TRUE(next->tryLock()) << alice.wire->text();
        EXPECT_EQ(alice.write("dateFile", "why"), 204);
        next->unlock();
        auto free = lock(second);
        EXPECT_TRUE(free->tryLock());
        free->unlock();
    }
}

TEST_F(Locks, ALockThatIsHeldIsNotTakenOverByAnotherObjectOfTheSameClient) {
    auto mine = lock(alice);
    ASSERT_TRUE(mine->tryLock());
    EXPECT_FALSE(lock(alice)->tryLock());
    EXPECT_TRUE(mine->renew());
    mine->unlock();
}

TEST_F(Locks, AClockThatIsSetMeanwhileNeitherShortensNorLengthensIt) {
    ManualClock clock(Date(1800000000));
    StoreLock mine(alice.manager.impl(), alice.at("dateFile"), LockLedger(""), clock);
    ASSERT_TRUE(mine.tryLock());
    for (const double jump : {0.0, -86400.0, 3 * 86400.0}) {
        clock.advance(jump);
        EXPECT_NEAR(mine.expires().secondsSince(clock.now()), CXWebDAVLock::lockTimeout(), 5) << jump;
    }
    mine.unlock();
}

TEST_F(Locks, AnUnheldLockNeverLooksSoonToExpire) {
    auto mine = lock(alice);
    EXPECT_GT(mine->expires().secondsSince(Clock::system().now()), CXWebDAVLock::lockTimeout() - 5);
    EXPECT_FALSE(mine->renew());
    mine->unlock();
    EXPECT_EQ(alice.wire->count("UNLOCK"), 0u);
}

TEST_F(Locks, AStoreThatCannotBeReachedGivesNoLock) {
    auto mine = lock(alice);
    world.store.stop();
    EXPECT_FALSE(mine->tryLock());
    EXPECT_FALSE(mine->locked());
}

TEST_F(Locks, WhoMayNotLockNeedsNoneAndTheWriteSaysSo) {
    Client bob{world, "bob"};
    auto none = makeStoreLock(bob.manager, bob.at("dateFile")); // alice's tree, never shared
    EXPECT_TRUE(none->tryLock());
    EXPECT_FALSE(none->locked());
    EXPECT_EQ(bob.write("dateFile", "who"), 403);
    EXPECT_TRUE(lock(alice)->tryLock()) << "the owner's is free";
    bob.wire->clear();
    none->unlock();
    EXPECT_EQ(bob.wire->methods(), "") << "there is nothing to give back";
}

class FileLocks : public testing::Test {
protected:
    TempDirectory directory;
    Url url = Url::fileURL(directory / ".lock");
    ManualClock clock{Date(1800000000)};
};

TEST_F(FileLocks, OneHolderAtATime) {
    auto a = makeFileLock(url, clock), b = makeFileLock(url, clock);
    ASSERT_TRUE(a->tryLock());
    EXPECT_FALSE(b->tryLock());
    EXPECT_EQ(a->url(), url);
    EXPECT_EQ(a->expires(), clock.now().addingSeconds(CXWebDAVLock::lockTimeout()));
    a->unlock();
    EXPECT_TRUE(b->tryLock());
    b->unlock();
    EXPECT_TRUE(std::filesystem::is_empty(directory.path()));
}

TEST_F(FileLocks, AnExpiredLockIsTakenOverAndItsHolderLearnsItAtTheRenewal) {
    auto a = makeFileLock(url, clock), b = makeFileLock(url, clock);
    ASSERT_TRUE(a->tryLock());
    clock.advance(CXWebDAVLock::lockTimeout() + 1);
    EXPECT_TRUE(b->tryLock());
    EXPECT_FALSE(a->renew());
    EXPECT_FALSE(a->locked());
    a->unlock();
    EXPECT_FALSE(makeFileLock(url, clock)->tryLock()) << "the former holder must not release it";
}

TEST_F(FileLocks, ARenewedLockIsNotTakenOver) {
    auto a = makeFileLock(url, clock), b = makeFileLock(url, clock);
    ASSERT_TRUE(a->tryLock());
    clock.advance(CXWebDAVLock::lockTimeout() - 10);
    EXPECT_TRUE(a->renew());
    clock.advance(CXWebDAVLock::lockTimeout() - 10);
    EXPECT_FALSE(b->tryLock());
}

TEST_F(FileLocks, AFolderThatIsMissingGivesNoLock) {
    EXPECT_FALSE(makeFileLock(Url::fileURL(directory / "no/.lock"), clock)->tryLock());
}

} // namespace
} // namespace rolvane
