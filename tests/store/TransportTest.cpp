#include "StoreWorld.h"
#include "support/FakeHttpServer.h"
#include "support/WaitUntil.h"

#include <chrono>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <thread>

namespace rolvane {
namespace {

using namespace test;
using testing::HasSubstr;

double since(std::chrono::steady_clock::time_point start) {
    return std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
}

HttpRequest get(const FakeHttpServer& server, const std::string& path = "/x") {
    HttpRequest r;
    r.method = "GET";
    r.url = Url(server.origin() + path);
    r.limits.totalSeconds = 10;
    return r;
}

std::unique_ptr<CurlTransport> plainTransport() {
    return std::make_unique<CurlTransport>(CurlTransportOptions());
}

TransportCredentials credentialsFor(const FakeHttpServer& server) {
    return {"alice", "secret", {Url(server.origin() + "/").origin()}, TransportCredentials::Scheme::automatic};
}

TEST(Transport, CredentialsGoOutUnaskedToTheirOrigin) {
    FakeHttpServer server([](const FakeRequest&) { return FakeAnswer::status(200); });
    auto transport = plainTransport();
    transport->setCredentials(credentialsFor(server));
    EXPECT_EQ(transport->perform(get(server)).status, 200);
    ASSERT_EQ(server.requests().size(), 1u);
    EXPECT_EQ(server.requests()[0].headers.at("authorization"), "Basic YWxpY2U6c2VjcmV0");
}

TEST(Transport, AnotherOriginNeverGetsThePassword) {
    FakeHttpServer store([](const FakeRequest&) { return FakeAnswer::status(200); });
    FakeHttpServer other(
        [](const FakeRequest&) { return FakeAnswer::status(401, "", "WWW-Authenticate: Basic realm=\"give\"\r\n"); });
    auto transport = plainTransport();
    transport->setCredentials(credentialsFor(store));
    EXPECT_EQ(transport->perform(get(store)).status, 200); // the handle has carried the password before
    EXPECT_EQ(transport->perform(get(other)).status, 401);
    ASSERT_FALSE(other.requests().empty());
    for (const auto& r : other.requests()) EXPECT_FALSE(r.headers.contains("authorization"));
}

TEST(Transport, ARedirectIsAnAnswerAndNotFollowed) {
    FakeHttpServer other([](const FakeRequest&) { return FakeAnswer::status(200); });
    FakeHttpServer server(
        [&](const FakeRequest&) { return FakeAnswer::status(302, "", "Location: " + other.origin() + "/y\r\n"); });
    auto transport = plainTransport();
    transport->setCredentials(credentialsFor(server));
    EXPECT_EQ(transport->perform(get(server)).status, 302);
    EXPECT_TRUE(other.requests().empty());
}

TEST(Transport, PlainHttpOffTheMachineIsNotSent) {
    auto transport = plainTransport();
    HttpRequest r;
    r.method = "GET";
    r.url = Url("http://192.0.2.1/x");
    const HttpResponse answer = transport->perform(r);
    EXPECT_EQ(answer.error, TransportError::refused);
    EXPECT_THAT(answer.detail, HasSubstr("https"));
}

TEST(Transport, HeadersWithLineBreaksAreNotSent) {
    FakeHttpServer server([](const FakeRequest&) { return FakeAnswer::status(200); });
    HttpRequest r = get(server);
    r.headers = {{"If", "x\r\nInjected: yes"}};
    EXPECT_EQ(plainTransport()->perform(r).error, TransportError::refused);
    EXPECT_TRUE(server.requests().empty());
}

TEST(Transport, DigestCostsOneChallengeAndThenGoesUnasked) {
    FakeHttpServer server([](const FakeRequest& r) {
        const auto found = r.headers.find("authorization");
        if (found == r.headers.end() || !found->second.starts_with("Digest"))
            return FakeAnswer::status(401, "", "WWW-Authenticate: Digest realm=\"r\", nonce=\"n1\", qop=\"auth\"\r\n");
        return FakeAnswer::status(201);
    });
    auto transport = plainTransport();
    transport->setCredentials(credentialsFor(server));
    for (int i = 0; i < 5; ++i) {
        HttpRequest r = get(server);
        r.method = "PUT";
        r.body = std::make_shared<const std::string>("text");
        EXPECT_EQ(transport->perform(r).status, 201);
    }
    int withBody = 0, refused = 0;
    for (const auto& r : server.requests()) {
        const bool digest = r.headers.contains("authorization") && r.headers.at("authorization").starts_with("Digest");
        withBody += digest && r.body == "text";
        refused += !digest;
    }
    EXPECT_EQ(withBody, 5);
    EXPECT_LE(refused, 2) << "one with Basic, one to learn the nonce";
}

TEST(Transport, TheTotalDeadlineHoldsAgainstASlowDrip) {
    FakeHttpServer server([](const FakeRequest&) {
        FakeAnswer a{{{0, "HTTP/1.1 200 OK\r\nContent-Length: 100000\r\n\r\n"}, {0.01, "x"}}, true, true, false};
        return a;
    });
    HttpRequest r = get(server);
    r.limits.totalSeconds = 0.4;
    const auto start = std::chrono::steady_clock::now();
    EXPECT_EQ(plainTransport()->perform(r).error, TransportError::timedOut);
    EXPECT_LT(since(start), 2.0);
}

TEST(Transport, TheReadDeadlineHoldsAgainstSilence) {
    FakeHttpServer server([](const FakeRequest&) { return FakeAnswer{{}, false, false, true}; });
    HttpRequest r = get(server);
    r.limits.idleSeconds = 0.3;
    const auto start = std::chrono::steady_clock::now();
    const HttpResponse answer = plainTransport()->perform(r);
    EXPECT_EQ(answer.error, TransportError::timedOut);
    EXPECT_LT(since(start), 2.0);
}

TEST(Transport, AnEndlessBodyEndsAtTheLimit) {
    FakeHttpServer server([](const FakeRequest&) {
        return FakeAnswer{{{0, "HTTP/1.1 200 OK\r\n\r\n"}, {0, std::string(65536, 'x')}}, true, true, false};
    });
    HttpRequest r = get(server);
    r.limits.maxBodyBytes = 1u << 20;
    EXPECT_EQ(plainTransport()->perform(r).error, TransportError::tooLarge);
}

TEST(Transport, AnAnnouncedBodyOverTheLimitIsNotRead) {
    FakeHttpServer server(
        [](const FakeRequest&) { return FakeAnswer::raw("HTTP/1.1 200 OK\r\nContent-Length: 99999999999\r\n\r\n"); });
    EXPECT_EQ(plainTransport()->perform(get(server)).error, TransportError::tooLarge);
}

TEST(Transport, EndlessHeadersEndAtTheLimit) {
    FakeHttpServer server([](const FakeRequest&) {
        return FakeAnswer{
            {{0, "HTTP/1.1 200 OK\r\n"}, {0, "X: " + std::string(1000, 'y') + "\r\n"}}, true, true, false};
    });
    EXPECT_EQ(plainTransport()->perform(get(server)).error, TransportError::tooLarge);
}

TEST(Transport, ABodyShorterThanAnnouncedIsNoAnswer) {
    FakeHttpServer server(
        [](const FakeRequest&) { return FakeAnswer::raw("HTTP/1.1 200 OK\r\nContent-Length: 100\r\n\r\nshort"); });
    EXPECT_EQ(plainTransport()->perform(get(server)).error, TransportError::truncated);
}

TEST(Transport, SomethingThatIsNotHttpIsNoAnswer) {
    FakeHttpServer server([](const FakeRequest&) { return FakeAnswer::raw("220 mail.example.org ESMTP\r\n"); });
    const HttpResponse answer = plainTransport()->perform(get(server));
    EXPECT_FALSE(answer.complete());
    EXPECT_EQ(answer.status, 0);
}

TEST(Transport, AClosedKeptAliveConnectionIsReplacedWithoutAFailure) {
    std::atomic<int> n{0};
    FakeHttpServer server([&](const FakeRequest&) {
        auto a = FakeAnswer::status(200, "ok");
        a.closes = ++n % 2 == 1; // without saying so
        return a;
    });
    auto transport = plainTransport();
    for (int i = 0; i < 6; ++i) EXPECT_EQ(transport->perform(get(server)).status, 200) << i;
}

TEST(Transport, TwentyThreadsShareAtMostTenConnections) {
    FakeHttpServer server([](const FakeRequest&) {
        return FakeAnswer{{{0.002, "HTTP/1.1 200 OK\r\nContent-Length: 2\r\n\r\nok"}}, false, false, false};
    });
    auto transport = plainTransport();
    std::atomic<int> good{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < 20; ++t)
        threads.emplace_back([&] {
            for (int i = 0; i < 20; ++i) good += transport->perform(get(server)).status == 200;
        });
    for (auto& t : threads) t.join();
    EXPECT_EQ(good, 400);
    EXPECT_LE(server.connections(), 10);
    EXPECT_EQ(transport->statistics().requests, 400u);
}

TEST(Transport, RetryAfterHoldsBackEverybodyAndTheRequestIsSentOnceMore) {
    std::atomic<int> n{0};
    std::atomic<bool> early{false};
    std::atomic<std::chrono::steady_clock::rep> refusedAt{0};
    const auto now = [] { return std::chrono::steady_clock::now().time_since_epoch().count(); };
    FakeHttpServer server([&](const FakeRequest&) {
        if (++n == 1) {
            refusedAt = now();
            return FakeAnswer::status(503, "", "Retry-After: 1\r\n");
        }
        early = early || std::chrono::steady_clock::duration(now() - refusedAt) < std::chrono::milliseconds(950);
        return FakeAnswer::status(200);
    });
    auto transport = plainTransport();
    EXPECT_EQ(transport->performAll({get(server)}).front().status, 200);
    EXPECT_FALSE(early);
    EXPECT_EQ(n, 2);
    EXPECT_EQ(transport->statistics().heldBack, 1u);
}

TEST(Transport, ARefusalWithoutRetryAfterIsTheAnswer) {
    FakeHttpServer server([](const FakeRequest&) { return FakeAnswer::status(503); });
    EXPECT_EQ(plainTransport()->perform(get(server)).status, 503);
    EXPECT_EQ(server.requests().size(), 1u);
}

TEST(Transport, ARetryAfterBeyondTheDeadlineIsTheAnswer) {
    FakeHttpServer server([](const FakeRequest&) { return FakeAnswer::status(503, "", "Retry-After: 50\r\n"); });
    auto transport = plainTransport();
    EXPECT_EQ(transport->perform(get(server)).status, 503);
    const auto start = std::chrono::steady_clock::now();
    EXPECT_EQ(transport->perform(get(server)).error, TransportError::timedOut) << "cannot be sent before its deadline";
    EXPECT_LT(since(start), 2.0);
}

TEST(Transport, AbortingEndsWhatIsUnderWayWithinASecondAndRefusesTheRest) {
    FakeHttpServer server([](const FakeRequest&) { return FakeAnswer{{}, false, false, true}; });
    auto transport = plainTransport();
    std::vector<std::thread> threads;
    std::atomic<int> aborted{0};
    for (int t = 0; t < 15; ++t)
        threads.emplace_back([&] { aborted += transport->perform(get(server)).error == TransportError::aborted; });
    EXPECT_TRUE(waitUntil([&] { return server.requests().size() >= 10; }, "ten requests under way"));
    const auto start = std::chrono::steady_clock::now();
    transport->abortAll();
    for (auto& t : threads) t.join();
    EXPECT_LT(since(start), 1.0);
    EXPECT_EQ(aborted, 15);
    EXPECT_EQ(transport->perform(get(server)).error, TransportError::aborted);
}

TEST(Transport, AfterAResumeRequestsGoOutAgain) {
    FakeHttpServer server([](const FakeRequest&) { return FakeAnswer::status(200); });
    auto transport = plainTransport();
    transport->abortAll();
    transport->resume();
    EXPECT_EQ(transport->perform(get(server)).status, 200);
}

TEST(Transport, ABodyGoesOutWholeAndUnchangedWithoutAskingFirst) {
    FakeHttpServer server([](const FakeRequest&) { return FakeAnswer::status(201); });
    HttpRequest r = get(server);
    r.method = "PUT";
    r.body = std::make_shared<const std::string>(std::string(3u << 20, 'p') + std::string(1, '\0') + "end");
    EXPECT_EQ(plainTransport()->perform(r).status, 201);
    ASSERT_EQ(server.requests().size(), 1u);
    EXPECT_EQ(server.requests()[0].body, *r.body);
    EXPECT_FALSE(server.requests()[0].headers.contains("expect"));
}

TEST(Transport, AHandleForgetsTheFormerRequest) {
    FakeHttpServer server(
        [](const FakeRequest& r) { return FakeAnswer::status(200, r.method == "HEAD" ? "" : "body"); });
    auto transport = plainTransport();
    const auto send = [&](const std::string& method, bool body) {
        HttpRequest r = get(server);
        r.method = method;
        if (body) r.body = std::make_shared<const std::string>("b");
        return transport->perform(r);
    };
    EXPECT_EQ(send("PUT", true).body, "body");
    EXPECT_EQ(send("HEAD", false).status, 200);
    EXPECT_EQ(send("GET", false).body, "body");
    EXPECT_EQ(send("PROPFIND", true).body, "body");
    EXPECT_EQ(send("DELETE", false).body, "body");
    std::string seen;
    for (const auto& r : server.requests()) seen += r.method + ":" + r.body + " ";
    EXPECT_EQ(seen, "PUT:b HEAD: GET: PROPFIND:b DELETE: ");
}

TEST(Transport, AStoreWhoseCertificateIsNotTrustedGetsNothing) {
    StoreWorld world;
    CurlTransport transport{CurlTransportOptions()}; // the system's authorities only
    HttpRequest r;
    r.method = "OPTIONS";
    r.url = Url(world.store.baseURL());
    EXPECT_EQ(transport.perform(r).error, TransportError::tls);
}

} // namespace
} // namespace rolvane
