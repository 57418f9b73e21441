#include "server/mod_davacl/NewcomerBound.h"

#include <algorithm>
#include <gtest/gtest.h>

namespace rolvane::davacl {
namespace {

using namespace std::chrono_literals;
using Clock = std::chrono::steady_clock;

const Clock::time_point kNow{1000h};

std::vector<Newcomer> many(size_t count, const std::string& address, std::chrono::milliseconds silent) {
    return std::vector<Newcomer>(count, {address, 4, false, kNow - silent});
}

void add(std::vector<Newcomer>& all, const std::vector<Newcomer>& more) {
    all.insert(all.end(), more.begin(), more.end());
}

TEST(NewcomerBound, ClosesNobodyWhoIsSlowWhileThereIsRoom) {
    EXPECT_TRUE(surplusOf(many(8, "a", 9s), kNow).empty()) << "twice the bound, in the middle of their handshakes";
    EXPECT_TRUE(surplusOf(many(4, "a", 1h), kNow).empty());
}

TEST(NewcomerBound, ClosesTheSilentDownToTheBound) {
    EXPECT_EQ(surplusOf(many(8, "a", 11s), kNow).size(), 4U);
    EXPECT_EQ(surplusOf(many(5, "a", 11s), kNow).size(), 1U);
}

TEST(NewcomerBound, IsShortWithAnAddressThatHasTwiceAsMuch) {
    EXPECT_EQ(surplusOf(many(100, "a", 1500ms), kNow).size(), 96U) << "down to the bound";
    EXPECT_TRUE(surplusOf(many(100, "a", 900ms), kNow).empty()) << "they have just come";
}

TEST(NewcomerBound, ClosesTheLongestSilentFirst) {
    auto all = many(1, "a", 10s);
    add(all, many(1, "a", 30s));
    add(all, many(1, "a", 20s));
    add(all, many(3, "a", 0s));
    EXPECT_EQ(surplusOf(all, kNow), (std::vector<size_t>{1, 2}));
}

TEST(NewcomerBound, CountsTheBusyAndClosesNoneOfThem) {
    auto all = many(8, "a", 1h);
    for (auto& each : all) each.busy = true;
    EXPECT_TRUE(surplusOf(all, kNow).empty());
    add(all, many(2, "a", 11s));
    EXPECT_EQ(surplusOf(all, kNow), (std::vector<size_t>{8, 9}));
}

TEST(NewcomerBound, IsEachAddresssOwn) {
    auto all = many(100, "a", 1h);
    add(all, many(4, "b", 1h));
    const auto surplus = surplusOf(all, kNow);
    EXPECT_EQ(surplus.size(), 96U);
    EXPECT_TRUE(std::all_of(surplus.begin(), surplus.end(), [](size_t i) { return i < 100; }));
}

} // namespace
} // namespace rolvane::davacl
