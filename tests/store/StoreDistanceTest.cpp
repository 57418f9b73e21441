#include "store/http/StoreDistance.h"

#include <gtest/gtest.h>

using namespace rolvane;

TEST(StoreDistance, IsThatOfTheQuickestOfSomeAnswers) {
    using Seconds = StoreDistance::Seconds;
    StoreDistance near, far, fresh;
    for (const double took : {0.2, 0.1, 0.001, 0.3}) near.answered(Seconds(took));
    for (const double took : {0.2, 0.1, 0.02, 0.3}) far.answered(Seconds(took));
    for (const double took : {0.2, 0.1, 0.02}) fresh.answered(Seconds(took));
    EXPECT_FALSE(near.isFar()) << "slow at first, as a login is";
    EXPECT_TRUE(far.isFar());
    EXPECT_FALSE(fresh.isFar()) << "not known yet";
}
