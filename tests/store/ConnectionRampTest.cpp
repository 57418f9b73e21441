#include "store/http/ConnectionRamp.h"
#include "store/http/HttpTransport.h"
#include "support/FakeHttpServer.h"

#include <algorithm>
#include <gtest/gtest.h>

namespace rolvane {
namespace {

using namespace test;
using namespace std::chrono_literals;

constexpr ConnectionRamp::Pace kPace;
constexpr auto kNear = kPace.far / 2;
constexpr auto kAway = kPace.far * 2;
constexpr int kMost = 10;
const ConnectionRamp::Steady kStart{};

int afterAnswers(ConnectionRamp& ramp, int number, ConnectionRamp::Seconds waited) {
    for (int i = 0; i < number; ++i) ramp.answered(kStart, waited);
    return ramp.allowed();
}

TEST(ConnectionRamp, BeginsWithFewAndGrowsWithTheAnswersOfANearStore) {
    ConnectionRamp ramp(kPace, kMost);
    EXPECT_EQ(ramp.allowed(), kPace.first);
    EXPECT_EQ(afterAnswers(ramp, kPace.answersForOneMore - 1, kNear), kPace.first);
    EXPECT_EQ(afterAnswers(ramp, 1, kNear), kPace.first + 1);
    EXPECT_EQ(afterAnswers(ramp, 1000, kNear), kMost);
    ramp.closed();
    EXPECT_EQ(ramp.allowed(), kPace.first);
}

TEST(ConnectionRamp, AllowsAllToAStoreThatIsFar) {
    ConnectionRamp ramp(kPace, kMost);
    EXPECT_EQ(afterAnswers(ramp, kPace.answersToJudge - 1, kAway), kPace.first) << "too early to tell";
    EXPECT_EQ(afterAnswers(ramp, 1, kAway), kMost);
    ramp.closed();
    EXPECT_EQ(ramp.allowed(), kMost) << "it has not come nearer";
}

TEST(ConnectionRamp, TakesNoBusyStoreForAFarOne) {
    ConnectionRamp ramp(kPace, kMost);
    ramp.answered(kStart, kNear);
    EXPECT_EQ(afterAnswers(ramp, kPace.answersToJudge, 5s), kPace.first);
}

TEST(ConnectionRamp, LetsOthersPassARequestThatHangs) {
    ConnectionRamp ramp(kPace, kMost);
    auto now = kStart;
    const auto after = [&](ConnectionRamp::Seconds wait) {
        now += std::chrono::duration_cast<ConnectionRamp::Steady::duration>(wait);
        ramp.othersWait(now);
        return ramp.allowed();
    };
    EXPECT_EQ(after(0s), kPace.first);
    EXPECT_EQ(after(kPace.firstPatience * 0.9), kPace.first);
    EXPECT_EQ(after(kPace.firstPatience * 0.2), kPace.first + 1);
    EXPECT_EQ(after(kPace.firstPatience), kPace.first + 1) << "the second one takes longer";
    EXPECT_EQ(after(kPace.firstPatience), kPace.first + 2);
    ramp.answered(now, kNear);
    EXPECT_EQ(after(kPace.firstPatience * 0.9), kPace.first + 2);
    EXPECT_EQ(after(kPace.firstPatience * 0.2), kPace.first + 3);
    for (int i = 0; i < 100; ++i) after(kPace.longestPatience);
    EXPECT_EQ(ramp.allowed(), kMost);
}

TEST(ConnectionRamp, AllowsNoMoreThanThereMayBe) {
    ConnectionRamp ramp(kPace, 1);
    EXPECT_EQ(ramp.allowed(), 1);
    EXPECT_EQ(afterAnswers(ramp, 100, kNear), 1);
}

bool allAnswered(HttpTransport& transport, const FakeHttpServer& server, size_t number) {
    HttpRequest request;
    request.method = "GET";
    request.url = Url(server.origin() + "/x");
    const auto answers = transport.performAll(std::vector<HttpRequest>(number, request));
    return std::all_of(answers.begin(), answers.end(), [](const HttpResponse& each) { return each.status == 200; });
}

// Neither a slow machine nor a hanging request lets more through.
ConnectionRamp::Pace withoutTime() {
    ConnectionRamp::Pace pace;
    pace.far = pace.firstPatience = pace.longestPatience = 1000h;
    return pace;
}

TEST(TransportToANearStore, HoldsFewConnectionsForFewRequests) {
    const FakeHttpServer server([](const FakeRequest&) { return FakeAnswer::status(200); });
    CurlTransportOptions options;
    options.fewAtFirst = withoutTime();
    CurlTransport transport(options);
    EXPECT_TRUE(allAnswered(transport, server, 30));
    EXPECT_LE(server.connections(), kPace.first + 30 / kPace.answersForOneMore);
    EXPECT_TRUE(allAnswered(transport, server, 300));
    EXPECT_GT(server.connections(), kPace.first + 30 / kPace.answersForOneMore) << "more for more";
}

} // namespace
} // namespace rolvane
