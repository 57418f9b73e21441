#include "HTTP2Connection.h"
#include "StoreTestWorld.h"

#include "server/mod_davacl/SlowThreads.h"

#include <gtest/gtest.h>
#include <memory>
#include <stdexcept>

// Who does not take answers away, or sends bodies slowly, holds threads of the store. Others must not notice, however
// many accounts hold them.

namespace rolvane {
namespace {

using davacl::SlowThread;
using std::chrono::milliseconds;

std::vector<SlowThread> threadsOf(const std::string& user, int count, milliseconds waited) {
    return std::vector<SlowThread>(static_cast<size_t>(count), SlowThread{user, waited, 0, true});
}

std::vector<SlowThread> operator+(std::vector<SlowThread> all, const std::vector<SlowThread>& more) {
    all.insert(all.end(), more.begin(), more.end());
    return all;
}

TEST(SlowThreads, GiveWayWhereOneUserHasMostOfThem) {
    const auto all = threadsOf("bob", 1, milliseconds(9000)) + threadsOf("alice", 2, milliseconds(5000)) +
                     threadsOf("carol", 3, milliseconds(2000));
    EXPECT_EQ(davacl::surplusOf(all, 6), std::vector<size_t>{});
    EXPECT_EQ(davacl::surplusOf(all, 5), std::vector<size_t>{5});
    EXPECT_EQ(davacl::surplusOf(all, 3).size(), 3u);
    for (const size_t i : davacl::surplusOf(all, 3)) EXPECT_NE(i, 0u) << "who has one goes on";
}

TEST(SlowThreads, AreThoseThatHaveWaitedForASecond) {
    const auto all = threadsOf("alice", 9, milliseconds(999));
    EXPECT_TRUE(davacl::surplusOf(all, 1).empty());
    EXPECT_FALSE(davacl::hasShareOf(all, 1, "alice"));
}

TEST(SlowThreads, TheLongestWaitOfAUserEndsFirst) {
    const auto all = threadsOf("alice", 1, milliseconds(3000)) + threadsOf("alice", 1, milliseconds(8000)) +
                     threadsOf("alice", 1, milliseconds(1000));
    EXPECT_EQ(davacl::surplusOf(all, 2), std::vector<size_t>{1});
}

TEST(SlowThreads, AnAnswerIsToBeTakenAwayAtALeastPace) {
    SlowThread thread{"alice", std::chrono::seconds(80), 20 * 500, true};
    EXPECT_TRUE(davacl::surplusOf({thread}, 10).empty());
    thread.waited += std::chrono::seconds(1);
    EXPECT_EQ(davacl::surplusOf({thread}, 10).size(), 1u);
    thread.sends = false; // bodies have bounds of their own
    EXPECT_TRUE(davacl::surplusOf({thread}, 10).empty());
}

TEST(SlowThreads, WhoHasAShareOfAllThatMayBeSlowIsRefusedAndNobodyElse) {
    const auto all = threadsOf("alice", 3, milliseconds(2000)) + threadsOf("carol", 3, milliseconds(2000)) +
                     threadsOf("bob", 1, milliseconds(2000));
    EXPECT_TRUE(davacl::hasShareOf(all, 6, "alice"));
    EXPECT_TRUE(davacl::hasShareOf(all, 6, "carol"));
    EXPECT_FALSE(davacl::hasShareOf(all, 6, "bob")) << "a third of six is two";
    EXPECT_FALSE(davacl::hasShareOf(all, 6, "dora"));
    EXPECT_FALSE(davacl::hasShareOf(all, 8, "alice"));
}

constexpr int kThreads = 8, kHolders = 2 * kThreads;

class SlowTakers : public testing::Test {
protected:
    SlowTakers() : store(options()) {
        for (const char* user : {"alice", "carol", "bob"}) store.addUser(user, "word");
        store.start();
        for (const char* user : {"alice", "bob"}) {
            const CurlClient client(store, user, "word");
            const std::string tree = std::string("/") + user;
            EXPECT_EQ(client.request("PUT", tree + "/small", {}, "x").status, 201);
            EXPECT_EQ(client.request("PUT", tree + "/large", {}, std::string(kLarge, 'x')).status, 201);
        }
    }
    PrivateStoreOptions options() const {
        PrivateStoreOptions all = optionsIn(directory);
        all.threadsPerProcess = kThreads;
        all.maximumProcesses = 1;
        all.extraConfiguration = {"RequestReadTimeout body=600", "Timeout 600", "H2StreamTimeout 600"};
        return all;
    }
    static std::string head(const std::string& method, const std::string& path, const std::string& user) {
        const std::string words = user == "bob"     ? "Ym9iOndvcmQ="
                                  : user == "carol" ? "Y2Fyb2w6d29yZA=="
                                                    : "YWxpY2U6d29yZA==";
        return method + " " + path + " HTTP/1.1\r\nHost: localhost\r\nAuthorization: Basic " + words + "\r\n";
    }
    int port() const { return store.status().port; }
    void expectThatBobIsServed() const {
        CurlClient bob(store, "bob", "word");
        EXPECT_EQ(bob.request("GET", "/bob/small").status, 200);
        bob.extraArguments = {"--http2"};
        EXPECT_EQ(bob.request("GET", "/bob/small").status, 200);
    }
    static constexpr size_t kLarge = 16'000'000; // more than sockets hold
    StoreDirectory directory;
    PrivateStore store;
};

TEST_F(SlowTakers, OfOneUserLeaveThreadsToOthers) {
    TLSConnection bobs(port()); // takes an answer away slowly, too, and is alone in that
    bobs.write(head("GET", "/dav/bob/large", "bob") + "\r\n");
    std::vector<std::unique_ptr<TLSConnection>> all;
    for (int i = 0; i < kHolders; ++i) {
        all.push_back(std::make_unique<TLSConnection>(port()));
        all.back()->write(head("GET", "/dav/alice/large", "alice") + "\r\n");
    }
    expectThatBobIsServed();
    const std::string answer = bobs.read(kLarge);
    EXPECT_TRUE(answer.starts_with("HTTP/1.1 200")) << answer.substr(0, 100);
    EXPECT_EQ(answer.size(), kLarge);
    all.clear();
    EXPECT_EQ(CurlClient(store, "alice", "word").request("GET", "/alice/small").status, 200);
}

TEST_F(SlowTakers, OfSeveralUsersLeaveThreadsToOthersWhateverHoldsThem) {
    std::vector<std::unique_ptr<TLSConnection>> all;
    for (int i = 0; i < kHolders; ++i) {
        const std::string user = i % 2 ? "alice" : "carol", path = "/dav/" + user + "/f" + std::to_string(i);
        all.push_back(std::make_unique<TLSConnection>(port()));
        all.back()->write(head("PUT", path, user) + "Content-Length: 2\r\n\r\n");
    }
    expectThatBobIsServed();
}

TEST_F(SlowTakers, OverHTTP2WithoutAWindowLeaveThreadsToOthers) {
    std::string names;
    constexpr int kNames = 900;
    for (int i = 0; i < kNames; ++i) names += "<x" + std::to_string(i) + std::string(30, 'x') + " xmlns='urn:x'/>";
    const std::string body = "<D:propfind xmlns:D='DAV:'><D:prop>" + names + "</D:prop></D:propfind>";
    constexpr size_t kPiece = 16000;
    std::vector<std::unique_ptr<HTTP2Connection>> all;
    for (int i = 0; i < kHolders; ++i) { // answers that are made in memory: three members, each with all names
        all.push_back(std::make_unique<HTTP2Connection>(port(), 0));
        try {
            const uint32_t stream = all.back()->request("alice", "PROPFIND", "/dav/alice/", {{"depth", "1"}}, true);
            for (size_t at = 0; at < body.size(); at += kPiece)
                all.back()->data(stream, body.substr(at, kPiece), at + kPiece >= body.size());
        } catch (const std::runtime_error&) { // the store has had enough of her
        }
    }
    for (int i = 0; i < kHolders; ++i) { // and files
        all.push_back(std::make_unique<HTTP2Connection>(port(), 0));
        all.back()->request("alice", "GET", "/dav/alice/large");
    }
    expectThatBobIsServed();
}

TEST_F(SlowTakers, OverHTTP2WithAWindowAndAFullSocketLeaveThreadsToOthers) {
    constexpr uint32_t kLargestWindow = 0x7fffffff;
    constexpr uint8_t kWindowUpdate = 8;
    std::vector<std::unique_ptr<HTTP2Connection>> all;
    for (int i = 0; i < kHolders; ++i) {
        all.push_back(std::make_unique<HTTP2Connection>(port(), kLargestWindow));
        all.back()->send({kWindowUpdate, 0, 0, {"\x7f\xff\x00\x00", 4}});
        all.back()->request("alice", "GET", "/dav/alice/large");
    }
    expectThatBobIsServed();
}

} // namespace
} // namespace rolvane
