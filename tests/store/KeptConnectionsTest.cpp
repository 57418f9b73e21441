#include "store/http/KeptConnections.h"
#include "Http2Server.h"
#include "StoreWorld.h"
#include "store/locks/CXWebDAVLock.h"
#include "support/FakeHttpServer.h"
#include "support/WaitUntil.h"

#include <arpa/inet.h>
#include <condition_variable>
#include <fstream>
#include <gtest/gtest.h>
#include <map>
#include <netinet/tcp.h>
#include <set>
#include <sstream>
#include <sys/socket.h>
#include <thread>

namespace rolvane {
namespace {

using namespace test;

constexpr int kConnections = 10; // what a client keeps at most

HttpRequest asking(const std::string& origin, const std::string& method, const std::string& path = "/x") {
    HttpRequest r;
    r.method = method;
    r.url = Url(origin + path);
    r.limits.totalSeconds = 20;
    if (method == "PUT" || method == "PROPFIND" || method == "LOCK")
        r.body = std::make_shared<const std::string>("the body");
    return r;
}

// Lets nobody through until so many have come.
class Gate {
public:
    explicit Gate(int expected) : _missing(expected) {}
    void pass() {
        std::unique_lock lock(_mutex);
        if (--_missing <= 0) _open.notify_all();
        _open.wait(lock, [this] { return _missing <= 0; });
    }

private:
    std::mutex _mutex;
    std::condition_variable _open;
    int _missing;
};

std::vector<HttpResponse> all(HttpTransport& transport, const FakeHttpServer& server, const std::string& method,
                              const std::string& path, int number) {
    return transport.performAll(
        std::vector<HttpRequest>(static_cast<size_t>(number), asking(server.origin(), method, path)));
}

// A server over which a client holds ten kept connections; `later` answers what comes after them.
struct Kept {
    explicit Kept(FakeHttpServer::Script later)
        : gate(kConnections), server([this, later = std::move(later)](const FakeRequest& r) {
              if (r.target != "/first") return later(r);
              gate.pass(); // so that each of the ten has a connection of its own
              return FakeAnswer::status(200);
          }),
          transport(CurlTransportOptions()) {
        for (const auto& answer : all(transport, server, "GET", "/first", kConnections))
            EXPECT_TRUE(answer.status == 200 && !answer.sentTwice) << answer.detail;
        EXPECT_EQ(server.connections(), kConnections);
    }
    Gate gate;
    FakeHttpServer server;
    CurlTransport transport;
};

// Such a server has closed its end, and the client hears of it only when it has sent the next request.
FakeAnswer closing() {
    return FakeAnswer::raw("");
}

const char* const kMethods[] = {"GET",    "HEAD", "OPTIONS",   "PROPFIND", "PUT",  "DELETE", "MKCOL",
                                "UNLOCK", "ACL",  "PROPPATCH", "LOCK",     "COPY", "MOVE"};

TEST(KeptConnections, ARequestThatMeetsOnlyConnectionsThatWereClosedGoesOutOnANewOne) {
    for (const std::string method : kMethods) {
        Kept kept([](const FakeRequest& r) {
            return r.connection <= kConnections ? closing() : FakeAnswer::status(200, r.method == "HEAD" ? "" : r.body);
        });
        const HttpResponse answer = kept.transport.perform(asking(kept.server.origin(), method));
        EXPECT_EQ(answer.status, 200) << method << ": " << answer.detail;
        EXPECT_TRUE(answer.sentTwice);
        if (method == "PUT") {
            EXPECT_EQ(answer.body, "the body");
        }
        EXPECT_EQ(kept.server.connections(), kConnections + 1) << method;
    }
}

TEST(KeptConnections, ABurstOfWorkersThatMeetsClosedConnectionsGoesOutWhole) {
    Kept kept([](const FakeRequest& r) { return r.connection <= kConnections ? closing() : FakeAnswer::status(201); });
    for (const auto& answer : all(kept.transport, kept.server, "PUT", "/x", 40))
        EXPECT_EQ(answer.status, 201) << answer.detail;
}

TEST(KeptConnections, AServerThatClosesAfterEachAnswerOnceMoreLosesNothing) {
    // Each connection serves two requests; the third one finds it closed.
    std::mutex mutex;
    std::map<int, int> served;
    Kept kept([&](const FakeRequest& r) {
        std::lock_guard guard(mutex);
        return ++served[r.connection] % 2 == 0 ? closing() : FakeAnswer::status(201);
    });
    for (int i = 0; i < 60; ++i) {
        const auto answer = kept.transport.perform(asking(kept.server.origin(), "PUT"));
        ASSERT_EQ(answer.status, 201) << i << ": " << answer.detail;
    }
}

TEST(KeptConnections, AServerThatClosesEverythingInTheMiddleOfABurstLosesNothing) {
    std::atomic<int> n{0};
    Gate burst(kConnections);
    FakeHttpServer* all10 = nullptr;
    Kept kept([&](const FakeRequest& r) {
        if (r.connection > kConnections) return FakeAnswer::status(201);
        burst.pass(); // all ten connections carry a request now
        if (++n == 1) all10->closeConnections();
        return FakeAnswer{{}, false, false, true}; // silence until the end is there
    });
    all10 = &kept.server;
    for (const auto& answer : all(kept.transport, kept.server, "PUT", "/x", 30))
        EXPECT_EQ(answer.status, 201) << answer.detail;
}

TEST(KeptConnections, WhatANewConnectionRefusesIsNotRepeatedForEver) {
    Kept kept([](const FakeRequest&) { return closing(); });
    const HttpResponse answer = kept.transport.perform(asking(kept.server.origin(), "PUT"));
    EXPECT_EQ(answer.error, TransportError::unreachable);
    EXPECT_TRUE(answer.sentTwice);
    int onNew = 0;
    for (const FakeRequest& r : kept.server.requests()) onNew += r.connection > kConnections;
    EXPECT_EQ(onNew, 1);
}

TEST(KeptConnections, AnAnswerThatHasBegunIsNotAskedForAgain) {
    Kept kept([](const FakeRequest&) { return FakeAnswer::raw("HTTP/1.1 201 Created\r\nContent-Le"); });
    EXPECT_FALSE(kept.transport.perform(asking(kept.server.origin(), "PUT")).complete());
    size_t puts = 0;
    for (const FakeRequest& r : kept.server.requests()) puts += r.method == "PUT";
    EXPECT_EQ(puts, 1u);
}

TEST(KeptConnections, AnAnswerWhoseHeaderWasCutOffIsNone) {
    for (const char* begun :
         {"HTTP/1.1 204 No Content\r\n", "HTTP/1.1 200 OK\r\nDAV: 1\r\nContent-Le", "HTTP/1.1 201"}) {
        FakeHttpServer server([=](const FakeRequest&) { return FakeAnswer::raw(begun); });
        CurlTransport transport{CurlTransportOptions()};
        const HttpResponse answer = transport.perform(asking(server.origin(), "PUT"));
        EXPECT_FALSE(answer.complete()) << begun;
        EXPECT_EQ(answer.status, 0) << begun;
    }
}

TEST(KeptConnections, AreGivenUpWhenTheNetworkChanges) {
    FakeHttpServer server([](const FakeRequest&) { return FakeAnswer::status(200); });
    CurlTransport transport{CurlTransportOptions()};
    for (int i = 1; i <= 3; ++i) {
        EXPECT_EQ(transport.perform(asking(server.origin(), "GET")).status, 200);
        EXPECT_EQ(transport.perform(asking(server.origin(), "GET")).status, 200);
        EXPECT_EQ(server.connections(), i);
        transport.networkChanged();
    }
}

// A server would hold a thousand of them for a thousand programs at rest.
TEST(KeptConnections, AreClosedSoonAfterTheLastRequest) {
    const int listener = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t size = sizeof address;
    ASSERT_EQ(bind(listener, reinterpret_cast<sockaddr*>(&address), size), 0);
    ASSERT_EQ(listen(listener, 1), 0);
    ASSERT_EQ(getsockname(listener, reinterpret_cast<sockaddr*>(&address), &size), 0);
    CurlTransport transport{CurlTransportOptions()};
    bool closed = false;
    std::thread server([&] {
        const int peer = accept(listener, nullptr, nullptr);
        const timeval patience{20, 0}; // seconds; a connection that stays is used for half a minute
        setsockopt(peer, SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience);
        char part[4096];
        const std::string answer = "HTTP/1.1 200 OK\r\nContent-Length: 0\r\n\r\n";
        if (recv(peer, part, sizeof part, 0) > 0 && send(peer, answer.data(), answer.size(), MSG_NOSIGNAL) > 0)
            closed = recv(peer, part, sizeof part, 0) == 0;
        close(peer);
    });
    const std::string origin = "http://127.0.0.1:" + std::to_string(ntohs(address.sin_port));
    EXPECT_EQ(transport.perform(asking(origin, "GET")).status, 200);
    server.join();
    close(listener);
    EXPECT_TRUE(closed);
}

TEST(KeptConnections, AreGivenUpAfterTheMachineSlept) {
    std::atomic<double> asleep{4000};
    FakeHttpServer server([](const FakeRequest&) { return FakeAnswer::status(200); });
    CurlTransportOptions options;
    options.secondsAsleep = [&asleep] { return asleep.load(); };
    CurlTransport transport(options);
    for (const auto& [seconds, expected] : {std::pair(0.0, 1), {0.5, 1}, {3600.0, 2}, {0.0, 2}, {2.0, 3}}) {
        asleep = asleep + seconds;
        EXPECT_EQ(transport.perform(asking(server.origin(), "GET")).status, 200);
        EXPECT_EQ(server.connections(), expected) << seconds;
    }
}

TEST(KeptConnections, WhatIsUnderWayGoesOnWhenTheNetworkChanges) {
    Gate arrived(2), changed(2);
    FakeHttpServer server([&](const FakeRequest& r) {
        if (r.target == "/slow") {
            arrived.pass();
            changed.pass();
        }
        return FakeAnswer::status(200);
    });
    CurlTransport transport{CurlTransportOptions()};
    std::thread slow([&] { EXPECT_EQ(transport.perform(asking(server.origin(), "GET", "/slow")).status, 200); });
    arrived.pass();
    transport.networkChanged();
    EXPECT_EQ(transport.perform(asking(server.origin(), "GET")).status, 200);
    changed.pass();
    slow.join();
}

TEST(KeptConnections, AreUsedForHalfAMinuteAtMostAndNeverUpToTheServersOwnTime) {
    using namespace std::chrono_literals;
    const std::string origin = "https://h:443";
    const auto now = std::chrono::steady_clock::now();
    KeptConnections kept([] { return 0.0; });
    EXPECT_EQ(kept.longestIdle(origin, now), 30);
    kept.heard(origin, answerOf(200, {{"keep-alive", "timeout=60, max=100"}}));
    EXPECT_EQ(kept.longestIdle(origin, now), 30);
    kept.heard(origin, answerOf(200, {{"keep-alive", "max=100, Timeout=5"}}));
    EXPECT_EQ(kept.longestIdle(origin, now), 3);
    EXPECT_EQ(kept.longestIdle("https://other:443", now), 30);
    kept.heard(origin, answerOf(200)); // says nothing new
    EXPECT_EQ(kept.longestIdle(origin, now), 3);
    kept.heard(origin, answerOf(200, {{"keep-alive", "timeout=1"}}));
    EXPECT_EQ(kept.longestIdle(origin, now), 0);
}

TEST(KeptConnections, OfAnAgeAtWhichOneWasDeadAreNotUsed) {
    using namespace std::chrono_literals;
    const std::string origin = "https://h:443";
    const auto now = std::chrono::steady_clock::now();
    KeptConnections kept([] { return 0.0; });
    kept.foundDead(origin, now);
    EXPECT_EQ(kept.longestIdle(origin, now), 0);
    EXPECT_EQ(kept.longestIdle(origin, now + 900ms), 0);
    EXPECT_EQ(kept.longestIdle(origin, now + 10500ms), 9) << "one that is ten seconds idle is older than the death";
    EXPECT_EQ(kept.longestIdle(origin, now + 100s), 30);
}

TEST(KeptConnections, TheServersTimeIsReadAsItIsWritten) {
    const auto said = [](const char* text) { return keepAliveSeconds(answerOf(200, {{"keep-alive", text}})); };
    EXPECT_EQ(said("timeout=5"), 5);
    EXPECT_EQ(said("max=3,timeout=7"), 7);
    EXPECT_EQ(said("TIMEOUT=8; max=1"), 8);
    EXPECT_EQ(said("notimeout=5"), std::nullopt);
    EXPECT_EQ(said("timeout="), std::nullopt);
    EXPECT_EQ(said("timeout=-1"), std::nullopt);
    EXPECT_EQ(said("timeout=99999999999"), std::nullopt);
    EXPECT_EQ(keepAliveSeconds(answerOf(200)), std::nullopt);
}

TEST(KeptConnections, OnlyMethodsThatMayBeRepeatedAre) {
    for (const std::string method : kMethods) EXPECT_TRUE(mayBeSentTwice(method)) << method;
    for (const std::string method : {"POST", "PATCH", "CONNECT", "", "get"})
        EXPECT_FALSE(mayBeSentTwice(method)) << method;
    Kept kept([](const FakeRequest&) { return closing(); });
    EXPECT_FALSE(kept.transport.perform(asking(kept.server.origin(), "POST")).complete());
    for (const FakeRequest& r : kept.server.requests()) EXPECT_LE(r.connection, kConnections);
}

TEST(KeptConnections, WhereNobodyAcknowledgesWhatWasSentTheyEndWithinTenSeconds) {
    FakeHttpServer server([](const FakeRequest&) { return FakeAnswer::status(200); });
    CurlTransport transport{CurlTransportOptions()};
    ASSERT_EQ(transport.perform(asking(server.origin(), "GET")).status, 200);
    int found = 0;
    for (const auto& entry : std::filesystem::directory_iterator("/proc/self/fd")) {
        const int fd = std::stoi(entry.path().filename());
        sockaddr_in peer{};
        socklen_t size = sizeof peer;
        if (getpeername(fd, reinterpret_cast<sockaddr*>(&peer), &size) != 0) continue;
        if (peer.sin_family != AF_INET || ntohs(peer.sin_port) != server.port()) continue;
        unsigned milliseconds = 0;
        size = sizeof milliseconds;
        getsockopt(fd, IPPROTO_TCP, TCP_USER_TIMEOUT, &milliseconds, &size);
        EXPECT_EQ(milliseconds, 10000u);
        ++found;
    }
    EXPECT_EQ(found, 1);
}

// A connection over HTTP/2 that has served one request, and a burst that meets what becomes of it.
struct KeptHttp2 {
    explicit KeptHttp2(Http2Server::Script later)
        : server(directory / "ca.pem",
                 [later = std::move(later)](Http2Server::Connection& connection, uint32_t stream) {
                     if (connection.number == 1 && connection.requests > 1) return later(connection, stream);
                     connection.sendOk(stream);
                 }),
          transport(options(directory / "ca.pem")) {
        const HttpResponse first = transport.perform(asking(server.origin(), "OPTIONS"));
        EXPECT_EQ(first.status, 200) << first.detail;
    }
    static CurlTransportOptions options(const std::string& caFile) {
        CurlTransportOptions o;
        o.caFile = caFile;
        return o;
    }
    std::vector<HttpResponse> burst() {
        return transport.performAll(std::vector<HttpRequest>(20, asking(server.origin(), "DELETE")));
    }
    TempDirectory directory;
    Http2Server server;
    CurlTransport transport;
};

TEST(KeptConnections, OverHttp2ThatSayGoodbyeLoseNothing) {
    KeptHttp2 kept([](Http2Server::Connection& connection, uint32_t) {
        if (connection.requests == 2) connection.sendGoAway(1, Http2Server::noError);
    });
    for (const auto& answer : kept.burst()) EXPECT_EQ(answer.status, 200) << answer.detail;
    EXPECT_LE(kept.server.connections(), 1 + kConnections);
}

TEST(KeptConnections, OverHttp2ThatCloseAfterTakingTheRequestsLoseNothing) {
    KeptHttp2 kept([](Http2Server::Connection& connection, uint32_t stream) {
        connection.sendGoAway(stream + 1000, Http2Server::noError); // as if it were going to answer
        connection.closes = true;
    });
    for (const auto& answer : kept.burst()) EXPECT_EQ(answer.status, 200) << answer.detail;
}

TEST(KeptConnections, OverHttp2ThatEndWithoutAWordLoseNothing) {
    KeptHttp2 kept([](Http2Server::Connection& connection, uint32_t) { connection.closes = true; });
    for (const auto& answer : kept.burst()) EXPECT_EQ(answer.status, 200) << answer.detail;
}

TEST(KeptConnections, OverHttp2StreamsThatWereRefusedAreSentAgain) {
    std::atomic<int> refused{0};
    KeptHttp2 kept([&](Http2Server::Connection& connection, uint32_t stream) {
        if (++refused <= 3)
            connection.sendReset(stream, Http2Server::refusedStream);
        else
            connection.sendOk(stream);
    });
    for (const auto& answer : kept.burst()) EXPECT_EQ(answer.status, 200) << answer.detail;
    EXPECT_GE(refused, 1);
}

// A client of which every conditional write is carried out, and then answered as a repetition of it would be.
TEST(RepeatedRequests, AWriteThatMeetsItsOwnVersionHasSucceeded) {
    StoreWorld world;
    Client alice(world), other(world);
    ASSERT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true));
    // Each PUT is sent twice, and the answer to the first one lost.
    const auto direct = world.transport();
    alice.wire->intercept([&](const HttpRequest& r) -> std::optional<HttpResponse> {
        if (r.method != "PUT") return std::nullopt;
        EXPECT_LT(direct->perform(r).status, 300);
        return direct->perform(r);
    });
    EXPECT_EQ(alice.read("x").first, 404);
    EXPECT_EQ(alice.write("x", Dictionary{{"a", 1}}), 204) << "If-None-Match has met the first one";
    EXPECT_EQ(alice.read("x").second, (Dictionary{{"a", 1}}));
    EXPECT_EQ(alice.write("x", Dictionary{{"a", 2}}), 204) << "If-Match has met the first one";
    EXPECT_EQ(alice.read("G:CXGroup").first, 404);
    EXPECT_EQ(alice.write("G:CXGroup", Dictionary{{"g", 1}}), 204);
    EXPECT_TRUE(alice.manager.failures().take().empty());
    // It counts as written: the next listing gives it as seen.
    const auto listing = alice.manager.infoForFilesInContainer(alice.base);
    ASSERT_TRUE(listing);
    EXPECT_TRUE(listing->at("/alice/Contacts/x").seen);
    EXPECT_EQ(other.read("x").second, (Dictionary{{"a", 2}}));
}

TEST(RepeatedRequests, AWriteThatMeetsAnothersVersionHasFailed) {
    StoreWorld world;
    Client alice(world), other(world);
    ASSERT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true));
    ASSERT_EQ(alice.read("x").first, 404);
    ASSERT_EQ(other.write("x", Dictionary{{"a", "other's"}}), 201);
    EXPECT_EQ(alice.write("x", Dictionary{{"a", "alice's"}}), 412);
    const auto failures = alice.manager.failures().take();
    ASSERT_EQ(failures.size(), 1u);
    EXPECT_EQ(failures[0].status, 412);
    EXPECT_EQ(other.read("x").second, (Dictionary{{"a", "other's"}}));
}

TEST(RepeatedRequests, AGroupThatBecomesACollectionTwiceIsOne) {
    StoreWorld world;
    Client alice(world);
    ASSERT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true));
    const auto direct = world.transport();
    alice.wire->intercept([&](const HttpRequest& r) -> std::optional<HttpResponse> {
        if (r.method != "MKCOL" && r.method != "COPY" && r.method != "MOVE" && r.method != "DELETE")
            return std::nullopt;
        direct->perform(r);
        return direct->perform(r);
    });
    ASSERT_EQ(alice.write("G:CXGroup", Dictionary{{"g", 1}}), 201);
    EXPECT_TRUE(alice.manager.createDirectoryAtAURL(alice.at("G:CXGroup")));
    EXPECT_EQ(alice.read("G:CXGroup").second, (Dictionary{{"g", 1}}));
    EXPECT_TRUE(alice.manager.createDirectoryAtAURL(alice.at("plain")));
    EXPECT_TRUE(alice.manager.removeFileAtURL(alice.at("plain"), nullptr));
    EXPECT_TRUE(alice.manager.failures().take().empty());
}

// How many connections of this process to the port stand, and how many of them the other end has closed.
struct Ends {
    int standing = 0, closedThere = 0;
};
Ends endsTo(int port) {
    std::set<std::string> inodes;
    for (const auto& fd : std::filesystem::directory_iterator("/proc/self/fd")) {
        std::error_code gone;
        const std::string link = std::filesystem::read_symlink(fd.path(), gone).string();
        if (link.starts_with("socket:[")) inodes.insert(link.substr(8, link.size() - 9));
    }
    Ends ends;
    char remote[16];
    snprintf(remote, sizeof remote, ":%04X", static_cast<unsigned>(port));
    for (const char* table : {"/proc/self/net/tcp", "/proc/self/net/tcp6"}) {
        std::ifstream in(table);
        for (std::string line; std::getline(in, line);) {
            std::istringstream fields(line);
            std::string number, local, peer, state, queues, timer, retransmits, user, timeout, inode;
            fields >> number >> local >> peer >> state >> queues >> timer >> retransmits >> user >> timeout >> inode;
            if (!peer.ends_with(remote) || !inodes.contains(inode)) continue;
            ends.standing += state == "01";    // ESTABLISHED
            ends.closedThere += state == "08"; // CLOSE_WAIT
        }
    }
    return ends;
}

// A store on a real httpd that closes what nobody used for a second, and a client that rests as long.
struct RestingWorld {
    explicit RestingWorld(bool http2) : world(options(http2)), alice(world) {}
    static PrivateStoreOptions options(bool http2) {
        PrivateStoreOptions o;
        o.keepAliveSeconds = 1;
        o.http2 = http2;
        return o;
    }
    void rest() {
        for (int i = 0; i < 4; ++i) burst();
        const int port = world.store.status().port;
        ASSERT_TRUE(waitUntil([&] { return endsTo(port).standing == 0; }, "the server closes its ends"));
        EXPECT_GT(endsTo(port).closedThere, 0) << "nothing of it was kept";
    }
    void burst() {
        std::vector<std::thread> workers;
        for (int i = 0; i < kConnections; ++i) workers.emplace_back([this] { alice.read("info"); });
        for (auto& w : workers) w.join();
    }
    StoreWorld world;
    Client alice;
};

class RestingConnections : public testing::TestWithParam<bool> {};

TEST_P(RestingConnections, ThatTheServerEndsCostNoOperation) {
    RestingWorld resting(GetParam());
    Client& alice = resting.alice;
    CXDAVError error;
    ASSERT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true));
    auto lock = makeStoreLock(alice.manager, alice.at("dateFile"));
    resting.rest();
    EXPECT_TRUE(alice.manager.canReach(error)) << error.reason;
    resting.rest();
    EXPECT_TRUE(lock->tryLock());
    resting.rest();
    EXPECT_EQ(alice.write("x", Dictionary{{"a", 1}}), 201);
    resting.rest();
    lock->unlock();
    EXPECT_TRUE(makeStoreLock(alice.manager, alice.at("dateFile"))->tryLock());
    resting.rest();
    EXPECT_TRUE(alice.manager.infoForFilesInContainer(alice.base));
    EXPECT_TRUE(alice.manager.failures().take().empty());
}

INSTANTIATE_TEST_SUITE_P(OverHttp, RestingConnections, testing::Values(false, true),
                         [](const auto& version) { return version.param ? "2" : "1"; });

} // namespace
} // namespace rolvane
