#include "daemon/RetrySchedule.h"
#include "daemon/OwnPasses.h"

#include <cmath>
#include <random>
#include <string>
#include <vector>

#include <gtest/gtest.h>

using namespace rolvane;

namespace {

using What = RetrySchedule::What;

constexpr double kLook = 300;

PassResult fine(bool full = true) {
    PassResult pass;
    pass.full = full;
    return pass;
}
PassResult left(double retryAfter = 0) {
    PassResult pass = fine();
    pass.left = true;
    pass.retryAfter = retryAfter;
    return pass;
}
PassResult away() {
    PassResult pass = left();
    pass.storeAway = true;
    return pass;
}
PassResult refused() {
    PassResult pass = left();
    pass.passwordRefused = true;
    return pass;
}
PassResult trickle(PassResult pass) {
    pass.full = false;
    return pass;
}

// "pass@300", "ask@10", "never".
std::string named(const std::optional<RetrySchedule::Next>& next) {
    if (!next) return "never";
    const char* what = next->what == What::ask ? "ask@" : next->what == What::pass ? "pass@" : "network@";
    return what + std::to_string(static_cast<long>(std::lround(next->at)));
}

struct Happened {
    double at;
    PassResult pass;
};
struct Row {
    const char* why;
    std::vector<Happened> happened;
    double lookInterval;
    std::string next;
};

} // namespace

TEST(RetrySchedules, WhatIsDueAfterWhatHasHappened) {
    const Row rows[] = {
        {"no pass was made: nothing is shared", {}, kLook, "never"},
        {"others' news, five minutes after a full pass", {{100, fine()}}, kLook, "pass@400"},
        {"an edit that was carried does not look at the trees",
         {{100, fine()}, {250, trickle(fine())}},
         kLook,
         "pass@400"},
        {"whoever wanted the pass", {{100, fine()}, {399, fine()}}, kLook, "pass@699"},
        {"another interval", {{100, fine()}}, 60, "pass@160"},
        {"never", {{100, fine()}}, 0, "never"},
        {"something waits: soon", {{100, left()}}, kLook, "pass@110"},
        {"an edit was not carried: soon", {{100, fine()}, {200, trickle(left())}}, kLook, "pass@210"},
        {"the store is away: a question first", {{100, away()}}, kLook, "ask@110"},
        {"also without looks", {{100, away()}}, 0, "ask@110"},
        {"edits in between do not put it off", {{100, away()}, {105, trickle(away())}}, kLook, "ask@110"},
        {"and it is not away any more", {{100, away()}, {105, trickle(left())}}, kLook, "pass@110"},
        {"all is well again", {{100, away()}, {105, fine()}}, kLook, "pass@405"},
        {"Retry-After is heeded", {{100, left(120)}}, kLook, "pass@220"},
        {"by the look as well", {{100, left(1000)}, {101, trickle(fine())}}, kLook, "pass@1100"},
        {"a shorter one than the pause changes nothing", {{100, left(3)}}, kLook, "pass@110"},
        {"one beyond reason is a day", {{100, left(1e9)}}, kLook, "pass@86500"},
        {"a refused password is not offered again soon", {{100, refused()}}, 0, "pass@1000"},
    };
    for (const Row& row : rows) {
        RetrySchedule schedule;
        for (const Happened& each : row.happened) schedule.ended(each.pass, each.at);
        EXPECT_EQ(named(schedule.next(row.lookInterval)), row.next) << row.why;
    }
}

TEST(RetrySchedules, PausesDoubleUpToFiveMinutesAndStayThere) {
    RetrySchedule schedule;
    double now = 0;
    schedule.ended(away(), now);
    std::vector<double> pauses;
    for (int i = 0; i < 9; ++i) {
        const auto next = schedule.next(kLook);
        ASSERT_TRUE(next);
        EXPECT_EQ(next->what, What::ask);
        pauses.push_back(next->at - now);
        now = next->at;
        schedule.beginsAttempt(now);
        schedule.storeWasAway(now, 0);
    }
    EXPECT_EQ(pauses, (std::vector<double>{10, 20, 40, 80, 160, 300, 300, 300, 300}));
    schedule.ended(fine(), now);
    schedule.ended(trickle(left()), now + 1);
    EXPECT_EQ(named(schedule.next(kLook)), "pass@" + std::to_string(std::lround(now + 11))) << "soon again";
}

TEST(RetrySchedules, TheNetworksReturnIsAtOnceAndRetryAfterStands) {
    RetrySchedule schedule;
    schedule.ended(away(), 100);
    schedule.networkChanged(103);
    EXPECT_EQ(named(schedule.next(kLook)), "network@103");
    schedule.beginsAttempt(103);
    schedule.ended(fine(), 104);
    EXPECT_EQ(named(schedule.next(kLook)), "pass@404");
    schedule.ended(left(60), 200);
    schedule.networkChanged(201);
    EXPECT_EQ(named(schedule.next(kLook)), "network@260");
}

TEST(RetrySchedules, AnAttemptThatLeadsToNoPassIsRepeatedAfterThePauseOnly) {
    RetrySchedule schedule;
    schedule.ended(left(), 100);
    schedule.beginsAttempt(110);
    EXPECT_EQ(named(schedule.next(kLook)), "pass@120");
    RetrySchedule looking;
    looking.ended(fine(), 100);
    looking.beginsAttempt(400);
    EXPECT_EQ(named(looking.next(kLook)), "pass@700");
}

// A day of a store that is away most of the time, a network that comes and goes, edits and commands: in no hour more
// than sixty requests of the schedule's own meet a store that is away, at two an attempt. And once it is there, the
// next pass is never far.
TEST(RetrySchedules, NeverMoreThanSixtyRequestsAnHourToAStoreThatIsAway) {
    for (unsigned seed = 0; seed < 40; ++seed) {
        std::mt19937 random(seed);
        const auto chance = [&](unsigned oneIn) { return random() % oneIn == 0; };
        RetrySchedule schedule;
        std::deque<double> requests;
        bool there = false;
        schedule.ended(away(), 0);
        double lastThere = 0;
        const unsigned flaps = seed % 4 == 0 ? 1 : seed % 4 == 1 ? 30 : 2000; // from every second on
        for (double now = 1; now < 86400; ++now) {
            if (chance(7200)) there = !there;
            if (chance(flaps)) schedule.networkChanged(now);
            if (chance(900)) schedule.ended(trickle(there ? fine() : away()), now);
            const auto next = schedule.next(kLook);
            ASSERT_TRUE(next);
            ASSERT_LE(next->at, std::max(now, lastThere) + RetrySchedule::kHour) << "it would never come to it";
            if (next->at > now) continue;
            const bool counts = !there;
            schedule.beginsAttempt(now);
            if (!there && next->what != What::pass)
                schedule.storeWasAway(now, 0);
            else
                schedule.ended(there ? fine() : away(), now);
            if (counts) requests.insert(requests.end(), 2, now);
            while (!requests.empty() && requests.front() <= now - RetrySchedule::kHour) requests.pop_front();
            ASSERT_LE(requests.size(), 60U) << "seed " << seed << " at " << now;
            lastThere = now;
        }
    }
}

namespace {

PassFailure failure(int status, std::optional<double> retryAfter = std::nullopt) {
    PassFailure why;
    why.method = "PUT";
    why.status = status;
    why.retryAfterSeconds = retryAfter;
    return why;
}

PassOutcome reached() {
    PassOutcome outcome;
    outcome.full = outcome.storeReached = true;
    PassTree own, bobs;
    own.user = UserName("<self>");
    bobs.user = UserName("bob");
    outcome.trees = {own, bobs};
    return outcome;
}

} // namespace

TEST(PassResults, AreReadOffTheOutcome) {
    PassOutcome outcome = reached();
    EXPECT_FALSE(resultOf(outcome).left);
    EXPECT_TRUE(resultOf(outcome).full);

    outcome.trees[0].out.waiting = 2;
    outcome.trees[0].out.why = failure(503, 90);
    EXPECT_TRUE(resultOf(outcome).left);
    EXPECT_FALSE(resultOf(outcome).storeAway);
    EXPECT_EQ(resultOf(outcome).retryAfter, 90);
    EXPECT_FALSE(resultOf(outcome).passwordRefused);

    outcome.trees[0].out.why = failure(401);
    EXPECT_TRUE(resultOf(outcome).passwordRefused);

    outcome = reached();
    outcome.trees[0].listsWait = true;
    EXPECT_TRUE(resultOf(outcome).left);

    outcome = reached();
    outcome.trees[1].in.waitingSince = Date(1);
    EXPECT_TRUE(resultOf(outcome).left);
    outcome.trees[1].leftAlone = true;
    EXPECT_FALSE(resultOf(outcome).left) << "it waits for its owner's daemon";

    outcome = reached();
    outcome.trees[0].out.refused = 3;
    EXPECT_FALSE(resultOf(outcome).left) << "another pass would be refused as well";

    outcome = reached();
    outcome.exception = "a fault";
    EXPECT_TRUE(resultOf(outcome).left);

    outcome = reached();
    outcome.storeReached = false;
    outcome.storeFailure = failure(503, 30);
    EXPECT_TRUE(resultOf(outcome).storeAway);
    EXPECT_TRUE(resultOf(outcome).left);
    EXPECT_EQ(resultOf(outcome).retryAfter, 30);
}

TEST(LookIntervals, AreFiveMinutesUnlessThePreferenceSaysOtherwise) {
    EXPECT_EQ(OwnPasses::lookIntervalOf(std::nullopt), 300);
    EXPECT_EQ(OwnPasses::lookIntervalOf(60), 60);
    EXPECT_EQ(OwnPasses::lookIntervalOf(1), 30) << "no shorter one";
    EXPECT_EQ(OwnPasses::lookIntervalOf(0), 0) << "never";
    EXPECT_EQ(OwnPasses::lookIntervalOf(-1), 0);
}

namespace {

// OwnPasses in a world that notes what it is asked for.
struct OwnPassesInAWorld : testing::Test {
    double now = 1000;
    std::optional<double> wakes;
    bool there = true;
    double retryAfter = 0;
    std::vector<std::string> done;
    OwnPasses own{{
        [this] { return now; },
        [this](std::optional<double> at) { wakes = at; },
        [] { return kLook; },
        [this] {
            done.emplace_back("ask");
            return OwnPasses::Answer{there, retryAfter};
        },
        [this] {
            done.emplace_back("pass");
            if (there) own.passEnded(fine());
        },
        [this] {
            done.emplace_back("network");
            if (there) own.passEnded(fine());
            return OwnPasses::Answer{there, 0};
        },
        [this](std::function<void()> whenDone) {
            if (isPrepared) return false;
            done.emplace_back("prepare");
            prepared = std::move(whenDone);
            return true;
        },
    }};
    bool isPrepared = true;
    std::function<void()> prepared;
    void sleepUntilWoken() {
        ASSERT_TRUE(wakes);
        now = std::max(now, *wakes);
        own.wake();
    }
};

} // namespace

TEST_F(OwnPassesInAWorld, LookFiveMinutesAfterTheLastPass) {
    own.passEnded(fine());
    EXPECT_EQ(wakes, 1300);
    now = 1200; // somebody's command
    own.passEnded(fine());
    own.wake(); // a timer that was late
    EXPECT_TRUE(done.empty());
    EXPECT_EQ(wakes, 1500);
    sleepUntilWoken();
    EXPECT_EQ(done, std::vector<std::string>{"pass"});
    EXPECT_EQ(wakes, 1800);
}

TEST_F(OwnPassesInAWorld, AskUntilTheStoreIsBackAndMakeThePassThen) {
    own.passEnded(away());
    there = false;
    sleepUntilWoken();
    sleepUntilWoken();
    there = true;
    sleepUntilWoken();
    EXPECT_EQ(done, (std::vector<std::string>{"ask", "ask", "ask", "pass"}));
    EXPECT_EQ(now, 1070);
    EXPECT_EQ(wakes, 1370);
}

TEST_F(OwnPassesInAWorld, AskAgainWhenTheStoreWantsToBeAsked) {
    own.passEnded(away());
    there = false;
    retryAfter = 700;
    sleepUntilWoken();
    EXPECT_EQ(wakes, 1710);
}

TEST_F(OwnPassesInAWorld, ActOnTheNetworkAtOnce) {
    own.passEnded(away());
    there = false;
    now = 1005;
    own.networkChanged();
    EXPECT_EQ(wakes, 1005);
    sleepUntilWoken();
    EXPECT_EQ(done, std::vector<std::string>{"network"});
    there = true;
    now = 1007;
    own.networkChanged();
    sleepUntilWoken();
    EXPECT_EQ(done, (std::vector<std::string>{"network", "network"}));
    EXPECT_EQ(wakes, 1307);
}

TEST_F(OwnPassesInAWorld, AnExceptionOutOfAPassLeavesTheNextOneDue) {
    OwnPasses failing({[this] { return now; }, [this](std::optional<double> at) { wakes = at; }, [] { return kLook; },
                       [] {
                           return OwnPasses::Answer{true, 0};
                       },
                       []() -> void { throw std::runtime_error("a fault"); },
                       [] {
                           return OwnPasses::Answer{true, 0};
                       }});
    failing.passEnded(left());
    now = *wakes;
    EXPECT_THROW(failing.wake(), std::runtime_error);
    EXPECT_EQ(wakes, now + RetrySchedule::kFirstPause);
}

TEST_F(OwnPassesInAWorld, MakeAPassWhenItIsPreparedAndNotBefore) {
    own.passEnded(fine());
    isPrepared = false;
    sleepUntilWoken();
    EXPECT_EQ(done, std::vector<std::string>{"prepare"});
    EXPECT_EQ(wakes, std::nullopt);
    now += 3;
    PassResult edit; // carried meanwhile
    own.passEnded(edit);
    EXPECT_EQ(wakes, std::nullopt) << "it is not prepared twice";
    own.wake();
    EXPECT_EQ(done, std::vector<std::string>{"prepare"});
    prepared();
    EXPECT_EQ(done, (std::vector<std::string>{"prepare", "pass"}));
    EXPECT_EQ(wakes, now + kLook);
}

TEST_F(OwnPassesInAWorld, MakeNoPassThatSomebodyElseHasMadeWhileItWasPrepared) {
    own.passEnded(fine());
    isPrepared = false;
    sleepUntilWoken();
    own.passEnded(fine());
    prepared();
    EXPECT_EQ(done, std::vector<std::string>{"prepare"});
    EXPECT_EQ(wakes, now + kLook);
}

TEST_F(OwnPassesInAWorld, HeedTheNetworkWhileAPassIsPrepared) {
    own.passEnded(fine());
    isPrepared = false;
    sleepUntilWoken();
    own.networkChanged();
    EXPECT_EQ(wakes, now);
    sleepUntilWoken();
    EXPECT_EQ(done, (std::vector<std::string>{"prepare", "network"}));
}
