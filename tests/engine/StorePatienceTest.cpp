#include "engine/pass/StorePatience.h"
#include "store/dav/CXDAVManager.h"

#include <gtest/gtest.h>
#include <vector>

namespace rolvane {
namespace {

PassFailure answered(int status, std::optional<double> retryAfter = {}) {
    return {"GET", "x", status, 0, {}, retryAfter};
}

PassFailure unanswered(int error, const std::string& words = {}) {
    return {"GET", "x", 0, error, words, {}};
}

// Every pause, when each answer comes at once.
std::vector<double> pauses(const PassFailure& failure, double random = 0.5) {
    StorePatience patience;
    std::vector<double> all;
    double spent = 0;
    while (const auto pause = patience.pauseAfter(failure, spent, random)) {
        all.push_back(*pause);
        spent += *pause;
    }
    return all;
}

TEST(StorePatience, GrowsUpToABoundWithAStoreThatIsBusy) {
    for (const PassFailure& busy :
         {answered(408), answered(429), answered(502), answered(503), answered(504), unanswered(kCXDAVErrorTimedOut)}) {
        const auto all = pauses(busy);
        ASSERT_GT(all.size(), 10u) << busy.status;
        EXPECT_EQ(std::vector<double>(all.begin(), all.begin() + 6), (std::vector<double>{1, 2, 4, 8, 16, 20}));
        double sum = 0;
        for (const double each : all) sum += each;
        EXPECT_LE(sum, StorePatience::kForBusy);
        EXPECT_GT(sum, StorePatience::kForBusy - 2 * StorePatience::kLongestPause);
    }
}

TEST(StorePatience, IsShortWithAStoreThatTakesNoConnection) {
    const auto all = pauses(unanswered(kCXDAVErrorCannotConnect, "Connection refused"));
    EXPECT_EQ(all, (std::vector<double>{1, 2, 4}));
    EXPECT_TRUE(pauses(unanswered(kCXDAVErrorCannotConnect, "Could not resolve host")).empty());
}

TEST(StorePatience, IsNoneWhereTheAnswerLasts) {
    for (const int status : {200, 301, 400, 401, 403, 404, 405, 412, 423, 500, 501, 507})
        EXPECT_TRUE(pauses(answered(status)).empty()) << status;
    for (const int error : {kCXDAVErrorSecureConnection, kCXDAVErrorBadServerResponse, kCXDAVErrorAuthentication,
                            kCXDAVErrorNoPassword, kCXDAVErrorNoAccount})
        EXPECT_TRUE(pauses(unanswered(error)).empty()) << error;
}

TEST(StorePatience, ComesBackNoEarlierThanItWasAskedTo) {
    for (const double random : {0.0, 0.5, 1.0}) {
        StorePatience patience;
        const auto pause = patience.pauseAfter(answered(503, 30), 0, random);
        ASSERT_TRUE(pause);
        EXPECT_GE(*pause, 30);
        EXPECT_LE(*pause, 37.5);
    }
    StorePatience patience;
    EXPECT_FALSE(patience.pauseAfter(answered(503, 3600), 0, 0)) << "an hour is longer than anybody waits";
}

TEST(StorePatience, SpreadsThoseWhoWereSentAwayTogether) {
    StorePatience one, another;
    EXPECT_LT(*one.pauseAfter(answered(503), 0, 0.1), *another.pauseAfter(answered(503), 0, 0.9));
    EXPECT_FALSE(one.pauseAfter(answered(503), StorePatience::kForBusy, 0.1)) << "attempts take time, too";
}

} // namespace
} // namespace rolvane
