#include "foundation/Date.h"

#include <gtest/gtest.h>
#include <rapidcheck/gtest.h>

#include <cmath>
#include <limits>

namespace rolvane {
namespace {

constexpr double kSample = 1795218480; // 2026-11-20T23:48:00Z

TEST(DateTest, WritesTheThreeForms) {
    const Date d(kSample + 0.25);
    EXPECT_EQ(d.toISO8601(), "2026-11-20T23:48:00Z");
    EXPECT_EQ(d.toISO8601Precise(), "2026-11-20T23:48:00.250000Z");
    EXPECT_EQ(d.toHTTP(), "Fri, 20 Nov 2026 23:48:00 GMT");
}

TEST(DateTest, RoundsTowardsThePastBefore1970Too) {
    EXPECT_EQ(Date(-0.25).toISO8601(), "1969-12-31T23:59:59Z");
    EXPECT_EQ(Date(-0.25).toISO8601Precise(), "1969-12-31T23:59:59.750000Z");
}

TEST(DateTest, RoundsMicrosecondsToTheNearest) {
    EXPECT_EQ(Date(kSample + 0.000001).toISO8601Precise(), "2026-11-20T23:48:00.000001Z");
    EXPECT_EQ(Date(kSample - 0.0000001).toISO8601Precise(), "2026-11-20T23:48:00.000000Z");
}

TEST(DateTest, WritesTheNearestDateForWhatNoCalendarHas) {
    const double inf = std::numeric_limits<double>::infinity();
    EXPECT_EQ(Date(1e300).toISO8601(), "9999-12-31T23:59:59Z");
    EXPECT_EQ(Date(inf).toHTTP(), "Fri, 31 Dec 9999 23:59:59 GMT");
    EXPECT_EQ(Date(-inf).toISO8601Precise(), "0001-01-01T00:00:00.000000Z");
    EXPECT_EQ(Date(std::nan("")).toISO8601Precise(), "1970-01-01T00:00:00.000000Z");
    for (const double d : {1e300, inf, -inf, std::nan(""), -62135596801.0, 253402300800.0})
        EXPECT_FALSE(Date(d).isRepresentable()) << d;
    EXPECT_TRUE(Date(-62135596800.0).isRepresentable());
    EXPECT_TRUE(Date(253402300799.0).isRepresentable());
}

TEST(DateTest, TheFarFutureIsAfterAndTheFarPastBeforeEveryDateOfThisEra) {
    EXPECT_LT(Date::distantPast(), Date(-62135596800.0));
    EXPECT_EQ(Date::distantFuture().toISO8601(), "4001-01-01T00:00:00Z");
}

TEST(DateTest, ReadsISO8601WithFractionAndOffset) {
    EXPECT_EQ(Date::fromISO8601("2026-11-20T23:48:00Z"), Date(kSample));
    EXPECT_EQ(Date::fromISO8601("2026-11-20 23:48:00.5Z"), Date(kSample + 0.5));
    EXPECT_EQ(Date::fromISO8601("2026-11-21T01:18:00+01:30"), Date(kSample));
    EXPECT_EQ(Date::fromISO8601("2026-11-20T18:48:00-0500"), Date(kSample));
    EXPECT_EQ(Date::fromISO8601("2024-02-29T00:00:00Z")->toISO8601(), "2024-02-29T00:00:00Z");
}

TEST(DateTest, RefusesTextThatIsNoISO8601Date) {
    for (const char* bad : {"",
                            "2026",
                            "2026-11-20",
                            "2026-11-20T23:48:00",
                            "2026-11-20T23:48Z",
                            "2026-13-01T00:00:00Z",
                            "2023-02-29T00:00:00Z",
                            "2026-11-20T24:00:00Z",
                            "2026-11-20T23:60:00Z",
                            "2026-11-20T23:48:61Z",
                            "2026-11-20T23:48:00.Z",
                            "2026-11-20T23:48:00+1",
                            "2026-11-20T23:48:00+24:00",
                            "2026-11-20T23:48:00+00:60",
                            "2026-11-20T23:48:00Zx",
                            " 2026-11-20T23:48:00Z",
                            "-026-11-20T23:48:00Z",
                            "0000-12-31T00:00:00Z",
                            "0001-01-01T00:00:00+01:00",
                            "9999-12-31T23:59:59-01:00",
                            "2026-00-10T00:00:00Z",
                            "2026-10-00T00:00:00Z"})
        EXPECT_EQ(Date::fromISO8601(bad), std::nullopt) << bad;
}

TEST(DateTest, ReadsAllThreeFormsOfHTTP) {
    const Date expected(784111777);
    EXPECT_EQ(Date::fromHTTP("Sun, 06 Nov 1994 08:49:37 GMT"), expected);
    EXPECT_EQ(Date::fromHTTP("Sunday, 06-Nov-94 08:49:37 GMT"), expected);
    EXPECT_EQ(Date::fromHTTP("Sun Nov  6 08:49:37 1994"), expected);
}

TEST(DateTest, RefusesTextThatIsNoHTTPDate) {
    for (const char* bad :
         {"", "Sun, 06 Nov 1994 08:49:37", "Sun, 06 Nov 1994 08:49:37 GMT ", "06 Nov 1994 08:49:37 GMT",
          "Sun, 31 Feb 1994 08:49:37 GMT", "Sun, 06 Nou 1994 08:49:37 GMT", "Sun, -6 Nov 1994 08:49:37 GMT",
          "Sun, 06 Nov 1994 25:49:37 GMT", "Sun, 06 Nov 0000 08:49:37 GMT", "Sun, 06 Nov 1994 08:49:37 CET"})
        EXPECT_EQ(Date::fromHTTP(bad), std::nullopt) << bad;
    EXPECT_EQ(Date::fromHTTP(std::string_view("Sun, 06 Nov 1994 08:49:37 GMT\0x", 31)), std::nullopt);
}

RC_GTEST_PROP(DateTest, WholeSecondsReadBackFromBothForms, ()) {
    const Date d(static_cast<double>(*rc::gen::inRange<int64_t>(-62135596800, 253402300800)));
    RC_ASSERT(Date::fromISO8601(d.toISO8601()) == d);
    RC_ASSERT(Date::fromHTTP(d.toHTTP()) == d);
}

TEST(ManualClockTest, StandsUntilItIsMoved) {
    ManualClock clock{Date(100)};
    EXPECT_EQ(clock.now(), Date(100));
    clock.advance(2.5);
    EXPECT_EQ(clock.now(), Date(102.5));
    clock.set(Date(1));
    EXPECT_EQ(clock.now(), Date(1));
}

TEST(SystemClockTest, NeverShowsATimeBeforeThisProgramWasWritten) {
    EXPECT_GT(Clock::system().now(), Date(1.6e9));
}

} // namespace
} // namespace rolvane
