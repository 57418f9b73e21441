#include "AccessWorld.h"
#include "server/mod_davacl/NewsRing.h"

#include <csignal>
#include <fstream>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <signal.h>
#include <sstream>
#include <thread>
#include <vector>

// Who waits for news of a tree gets a line for each change of it, for as long as the tree may be read.

namespace rolvane {
namespace {

using davacl::NewsRing;
using testing::HasSubstr;
using testing::Not;
using testing::StartsWith;

const std::string kTree = "/dav/alice/Contacts", kOther = "/dav/alice/Other";

std::string report(const std::vector<std::string>& trees, const std::string& since = {}) {
    std::string text = "<R:news xmlns:R=\"http://rolvane.net/ns/\" xmlns:D=\"DAV:\">";
    for (const auto& tree : trees) text += "<D:href>" + tree + "/</D:href>";
    if (!since.empty()) text += "<R:since>" + since + "</R:since>";
    return text + "</R:news>";
}

// Waits in the name of a user. Lines are without their tokens; those of the heart are passed over.
class Reader {
public:
    Reader(const AccessWorld& world, const std::string& user, const std::vector<std::string>& trees,
           const std::string& since = {}, const std::string& writer = {})
        : _lines(world.port(), {user, "REPORT", "/dav/", headers(writer), report(trees, since)}) {}

    int status() { return _lines.status(); }
    std::string next() {
        for (;;) {
            const auto line = _lines.line();
            if (!line) return _lines.hasEnded() ? "(end)" : "(nothing)";
            std::istringstream words(*line);
            std::string what, which;
            words >> what;
            if (what == "news" || what == "no") words >> which;
            words >> token;
            if (what != "still") return what + (which.empty() ? "" : " " + which);
            ++beats;
        }
    }
    bool beatsOnce() {
        const auto line = _lines.line();
        return line && line->starts_with("still ");
    }
    std::string token; // of the last line
    int beats = 0;

private:
    static std::vector<std::pair<std::string, std::string>> headers(const std::string& writer) {
        if (writer.empty()) return {};
        return {{"Rolvane-Writer", writer}};
    }
    RawLines _lines;
};

PrivateStoreOptions withLines(std::vector<std::string> lines) {
    PrivateStoreOptions options;
    options.extraConfiguration = std::move(lines);
    return options;
}

// One world for all tests that change no configuration; each begins with alice's trees as they are made.
class News : public testing::Test {
protected:
    static void SetUpTestSuite() { shared = std::make_unique<AccessWorld>(AccessVariant::sanitized); }
    static void TearDownTestSuite() { shared.reset(); }
    void SetUp() override {
        world.reset();
        world.ask("alice", "DELETE", kOther + "/");
        ASSERT_EQ(world.status("alice", "MKCOL", kOther + "/"), 201);
    }
    static std::unique_ptr<AccessWorld> shared;
    const AccessWorld& world = *shared;
};
std::unique_ptr<AccessWorld> News::shared;

TEST_F(News, TellOfEveryKindOfChangeInATreeThatMayBeRead) {
    Reader rita(world, "rita", {kTree});
    ASSERT_EQ(rita.status(), 200);
    ASSERT_EQ(rita.next(), "begin");
    ASSERT_EQ(world.status("alice", "PUT", kTree + "/new", {}, "one"), 201);
    EXPECT_EQ(rita.next(), "news 1") << "PUT of what was not there";
    ASSERT_EQ(world.status("walter", "PUT", kTree + "/new", {}, "two"), 204);
    EXPECT_EQ(rita.next(), "news 1") << "PUT";
    ASSERT_EQ(world.status("alice", "MKCOL", kTree + "/deep/"), 201);
    EXPECT_EQ(rita.next(), "news 1") << "MKCOL";
    ASSERT_EQ(world.status("alice", "MOVE", kTree + "/new", {{"Destination", kTree + "/deep/moved"}}), 201);
    EXPECT_EQ(rita.next(), "news 1") << "MOVE";
    ASSERT_EQ(world.status("alice", "COPY", kTree + "/deep/moved", {{"Destination", kTree + "/copied"}}), 201);
    EXPECT_EQ(rita.next(), "news 1") << "COPY";
    ASSERT_EQ(world.status("alice", "DELETE", kTree + "/copied"), 204);
    EXPECT_EQ(rita.next(), "news 1") << "DELETE";
    ASSERT_EQ(world.status("alice", "ACL", kTree + "/", {}, AccessWorld::lists()), 200);
    EXPECT_EQ(rita.next(), "news 1") << "ACL";
    ASSERT_EQ(world.status("alice", "MOVE", kTree + "/deep/moved", {{"Destination", kOther + "/out"}}), 201);
    EXPECT_EQ(rita.next(), "news 1") << "MOVE out of the tree";
    ASSERT_EQ(world.status("alice", "MOVE", kOther + "/out", {{"Destination", kTree + "/in"}}), 201);
    EXPECT_EQ(rita.next(), "news 1") << "MOVE into the tree";
}

TEST_F(News, AreNeitherAClockFileNorALockNorWhatIsReadOrRefused) {
    Reader alice(world, "alice", {kTree, kOther});
    ASSERT_EQ(alice.next(), "begin");
    ASSERT_EQ(world.status("alice", "PUT", kTree + "/dateFile", {}, "now"), 204);
    const RawAnswer locked = world.ask("alice", "LOCK", kTree + "/1:CXGroup", {}, AccessWorld::kLock);
    ASSERT_EQ(locked.status, 200);
    const size_t token = locked.headers.find("Lock-Token: ") + 12;
    const std::string held = locked.headers.substr(token, locked.headers.find("\r", token) - token);
    ASSERT_EQ(world.status("alice", "UNLOCK", kTree + "/1:CXGroup", {{"Lock-Token", held}}), 204);
    ASSERT_EQ(world.status("rita", "PUT", kTree + "/file", {}, "mine"), 403);
    ASSERT_EQ(world.status("rita", "GET", kTree + "/1:CXGroup"), 200);
    ASSERT_EQ(world.status("alice", "DELETE", kTree + "/nothing"), 404);
    ASSERT_EQ(world.status("alice", "PUT", kOther + "/x", {}, "news"), 201);
    EXPECT_EQ(alice.next(), "news 2") << "all that came before it was no news";
}

TEST_F(News, OfATreeThatMayNotBeReadAreToldToNobody) {
    ASSERT_EQ(world.status("sam", "MKCOL", "/dav/sam/Contacts/"), 201);
    Reader sam(world, "sam", {kTree, "/dav/sam/Contacts"});
    ASSERT_EQ(sam.next(), "begin");
    EXPECT_EQ(sam.next(), "no 1");
    ASSERT_EQ(world.status("alice", "PUT", kTree + "/secret", {}, "one"), 201);
    ASSERT_EQ(world.status("sam", "PUT", "/dav/sam/Contacts/own", {}, "one"), 201);
    EXPECT_EQ(sam.next(), "news 2");
}

TEST_F(News, OfAChangeInAnOwnersOtherTreeConcernThatTreeAlone) {
    Reader rita(world, "rita", {kTree, "/dav/alice"});
    ASSERT_EQ(rita.next(), "begin");
    EXPECT_EQ(rita.next(), "no 2") << "the right is one on the tree";
    Reader alice(world, "alice", {kTree, "/dav/alice"});
    ASSERT_EQ(alice.next(), "begin");
    ASSERT_EQ(world.status("alice", "PUT", kOther + "/x", {}, "one"), 201);
    EXPECT_EQ(alice.next(), "news 2") << "it lies below the owner's own collection";
    ASSERT_EQ(world.status("alice", "PUT", kTree + "/x", {}, "one"), 201);
    EXPECT_EQ(rita.next(), "news 1");
}

TEST_F(News, EndWithTheRight) {
    Reader rita(world, "rita", {kTree});
    Reader walter(world, "walter", {kTree});
    ASSERT_EQ(rita.next(), "begin");
    ASSERT_EQ(walter.next(), "begin");
    const std::string without = AccessWorld::acl(AccessWorld::ace(AccessWorld::user("walter"), "read write"));
    ASSERT_EQ(world.status("alice", "ACL", kTree + "/", {}, without), 200);
    EXPECT_EQ(rita.next(), "(end)") << "the withdrawal is told by the end alone";
    EXPECT_EQ(walter.next(), "news 1");
    Reader again(world, "rita", {kTree}, rita.token);
    ASSERT_EQ(again.next(), "begin");
    EXPECT_EQ(again.next(), "no 1");
}

TEST_F(News, EndWithTheTree) {
    Reader rita(world, "rita", {kTree});
    ASSERT_EQ(rita.next(), "begin");
    ASSERT_EQ(world.status("alice", "DELETE", kTree + "/"), 204);
    EXPECT_EQ(rita.next(), "(end)") << "with it went its list";
}

TEST_F(News, OfTheTimeBetweenTwoRequestsAreToldByThePosition) {
    Reader first(world, "rita", {kTree});
    ASSERT_EQ(first.next(), "begin");
    const std::string position = first.token;
    Reader quiet(world, "rita", {kTree}, position);
    ASSERT_EQ(quiet.next(), "begin");
    ASSERT_EQ(world.status("alice", "PUT", kOther + "/x", {}, "one"), 201);
    ASSERT_EQ(world.status("alice", "PUT", kTree + "/x", {}, "one"), 201);
    EXPECT_EQ(quiet.next(), "news 1");
    Reader later(world, "rita", {kTree}, position);
    ASSERT_EQ(later.next(), "begin");
    EXPECT_EQ(later.next(), "news 1") << "it came between the position and the request";
    Reader now(world, "rita", {kTree}, later.token);
    ASSERT_EQ(now.next(), "begin");
    ASSERT_EQ(world.status("alice", "PUT", kTree + "/y", {}, "one"), 201);
    EXPECT_EQ(now.next(), "news 1");
    EXPECT_NE(now.token, later.token);
    for (const char* foreign : {"00112233445566778899aabbccddeeff", "nonsense"}) {
        Reader lost(world, "rita", {kTree}, foreign);
        ASSERT_EQ(lost.next(), "begin");
        EXPECT_EQ(lost.next(), "news 1") << "of a position that is not known anything may have changed";
    }
}

TEST_F(News, AreAnnouncedByOptionsWithAPositionToWaitFrom) {
    const RawAnswer options = world.ask("rita", "OPTIONS", kTree + "/");
    const std::string mark = "Rolvane-News: /dav/ ";
    const size_t at = options.headers.find(mark);
    ASSERT_NE(at, std::string::npos) << options.headers;
    const std::string position = options.headers.substr(at + mark.size(), 32);
    ASSERT_EQ(world.status("alice", "PUT", kTree + "/x", {}, "one"), 201);
    Reader rita(world, "rita", {kTree}, position);
    ASSERT_EQ(rita.next(), "begin");
    EXPECT_EQ(rita.next(), "news 1");
    EXPECT_THAT(
        world.ask("rita", "PROPFIND", kTree + "/", {{"Depth", "0"}}, AccessWorld::propfind("supported-report-set"))
            .body,
        HasSubstr("<R:news xmlns:R=\"http://rolvane.net/ns/\"/>"));
}

TEST_F(News, AreNotToldToTheProgramThatMadeThem) {
    Reader daemon(world, "alice", {kTree, kOther}, {}, "a1b2");
    ASSERT_EQ(daemon.next(), "begin");
    ASSERT_EQ(world.status("alice", "PUT", kTree + "/own", {{"Rolvane-Writer", "a1b2"}}, "one"), 201);
    ASSERT_EQ(world.status("walter", "PUT", kTree + "/other", {{"Rolvane-Writer", "a1b2"}}, "one"), 201);
    EXPECT_EQ(daemon.next(), "news 1") << "another user's of the same name";
    ASSERT_EQ(world.status("alice", "PUT", kTree + "/own", {{"Rolvane-Writer", "a1b2"}}, "two"), 204);
    ASSERT_EQ(world.status("alice", "PUT", kOther + "/own", {{"Rolvane-Writer", "c3d4"}}, "one"), 201);
    EXPECT_EQ(daemon.next(), "news 2") << "of the same user's other program, and not of its own";
}

TEST_F(News, AreRefusedWhereTheRequestMakesNoSense) {
    const auto status = [&](const std::string& user, const std::string& body) {
        return world.status(user, "REPORT", "/dav/", {}, body);
    };
    EXPECT_EQ(status("rita", report({})), 400) << "no tree";
    EXPECT_EQ(status("rita", report({"/dav"})), 400) << "the base";
    EXPECT_EQ(status("rita", report({kTree + "/far/down"})), 400) << "deeper than lists are kept";
    EXPECT_EQ(status("rita", report({"/elsewhere/alice"})), 400);
    EXPECT_EQ(status("rita", report({"http://example.org/dav/alice/Contacts"})), 400);
    EXPECT_EQ(status("rita", report({"/dav/alice/../sam"})), 400);
    EXPECT_EQ(status("rita", report(std::vector<std::string>(1001, kTree))), 400) << "too many";
    EXPECT_EQ(status("", report({kTree})), 401) << "nobody";
}

TEST_F(News, EndWithThePassword) {
    Reader sam(world, "sam", {"/dav/sam"});
    ASSERT_EQ(sam.next(), "begin");
    shared->store.addUser("sam", "another one");
    world.ask("sam", "PUT", "/dav/sam/x", {}, "refused");
    shared->store.addUser("sam", rawPasswordOf("sam")); // another line for the same password
    ASSERT_EQ(world.status("sam", "PUT", "/dav/sam/x", {}, "taken"), 201);
    EXPECT_EQ(sam.next(), "(end)");
}

// Whoever has found the former password out hears nothing more when its owner has chosen another one.
TEST_F(News, EndWithAPasswordOfOnesOwn) {
    Reader sam(world, "sam", {"/dav/sam"});
    ASSERT_EQ(sam.next(), "begin");
    ASSERT_EQ(world.status("sam", "POST", "/principals/users/sam", {{"Content-Type", "application/x-rolvane-password"}},
                           "chosen by sam"),
              204);
    const CurlClient chosen(shared->store, "sam", "chosen by sam");
    ASSERT_EQ(chosen.request("PUT", "/sam/own-password", {}, "x").status, 201);
    EXPECT_EQ(sam.next(), "(end)");
    shared->store.addUser("sam", rawPasswordOf("sam"));
}

TEST(NewsOfAStore, HaveAHeartbeatAndABoundForEachUser) {
    AccessWorld world(withLines({"DavAclNewsHeartbeat 1", "DavAclNewsOfUser 2"}));
    world.reset();
    auto first = std::make_unique<Reader>(world, "rita", std::vector{kTree});
    Reader second(world, "rita", {kTree});
    ASSERT_EQ(first->next(), "begin");
    ASSERT_EQ(second.next(), "begin");
    EXPECT_TRUE(first->beatsOnce());
    EXPECT_TRUE(first->beatsOnce());
    EXPECT_EQ(Reader(world, "rita", {kTree}).status(), 429);
    Reader walter(world, "walter", {kTree});
    EXPECT_EQ(walter.status(), 200) << "somebody else's do not count";
    first.reset();
    // The server notices that a client has gone by itself.
    int status = 0;
    for (int i = 0; i < 1000 && status != 200; ++i) status = Reader(world, "rita", {kTree}).status();
    EXPECT_EQ(status, 200);
}

TEST(NewsOfAStore, AreThereWithoutTheThreadsOfTheServer) {
    PrivateStoreOptions options = withLines({"DavAclNewsOfUser 100"});
    options.threadsPerProcess = 3;
    options.processes = options.maximumProcesses = 1;
    AccessWorld world(options);
    world.reset();
    std::vector<std::unique_ptr<Reader>> readers;
    for (int i = 0; i < 60; ++i) {
        readers.push_back(std::make_unique<Reader>(world, i % 2 ? "rita" : "walter", std::vector{kTree}));
        ASSERT_EQ(readers.back()->next(), "begin") << i;
    }
    ASSERT_EQ(world.status("alice", "PUT", kTree + "/x", {}, "one"), 201);
    for (auto& reader : readers) EXPECT_EQ(reader->next(), "news 1");
}

TEST(NewsOfAStore, AreAllAnsweredAtAGracefulRestartAndGoOnBehindIt) {
    PrivateStoreOptions options = withLines({"DavAclNewsOfUser 100"});
    options.processes = options.maximumProcesses = 2;
    AccessWorld world(options);
    world.reset();
    std::vector<std::unique_ptr<Reader>> readers;
    for (int i = 0; i < 20; ++i) {
        readers.push_back(std::make_unique<Reader>(world, "rita", std::vector{kTree}));
        ASSERT_EQ(readers.back()->next(), "begin") << i;
    }
    kill(world.store.status().pid, SIGUSR1);
    for (auto& reader : readers) EXPECT_EQ(reader->next(), "(end)");
    ASSERT_EQ(world.status("alice", "PUT", kTree + "/x", {}, "one"), 201);
    Reader again(world, "rita", {kTree}, readers.front()->token);
    ASSERT_EQ(again.next(), "begin");
    EXPECT_EQ(again.next(), "news 1") << "the position of before the restart holds";
    kill(world.store.status().pid, SIGUSR1);
    EXPECT_EQ(again.next(), "(end)");
}

TEST(NewsOfAStore, OfAChangeThroughOneProcessReachWhoWaitsInAnother) {
    PrivateStoreOptions options = withLines({"DavAclNewsOfUser 100"});
    options.processes = options.maximumProcesses = 4;
    AccessWorld world(options);
    world.reset();
    std::vector<std::unique_ptr<Reader>> readers;
    for (int i = 0; i < 24; ++i) {
        readers.push_back(std::make_unique<Reader>(world, "rita", std::vector{kTree}));
        ASSERT_EQ(readers.back()->next(), "begin") << i;
    }
    ASSERT_EQ(world.status("alice", "PUT", kTree + "/x", {}, "one"), 201);
    for (auto& reader : readers) EXPECT_EQ(reader->next(), "news 1");
}

TEST(NewsOfAStore, AreNotGivenOverHTTP2) {
    StoreDirectory directory;
    PrivateStore store(optionsIn(directory));
    store.addUser("alice", "one");
    store.start();
    CurlClient client(store, "alice", "one");
    client.extraArguments = {"--http2"};
    EXPECT_EQ(client.request("REPORT", "/", {"Content-Type: text/xml"}, report({"/dav/alice"})).status, 501);
}

TEST(NewsOfAStore, AreOffWhereNobodyHasSwitchedThemOn) {
    AccessWorld world(withLines({"DavAclNews Off"}));
    world.reset();
    EXPECT_EQ(Reader(world, "rita", {kTree}).status(), 501);
    EXPECT_THAT(world.ask("rita", "OPTIONS", kTree + "/").headers, Not(HasSubstr("Rolvane-News")));
}

// A file's list is small, but the ring has an end: who was away for longer is told that anything may have changed.
TEST(NewsRing, ForgetsOldNotesAndSaysSo) {
    NewsRing* ring = NewsRing::map();
    ASSERT_TRUE(ring);
    const uint64_t begin = ring->position();
    ring->post({7, 1});
    ring->post({8, 2});
    const auto two = ring->from(begin);
    ASSERT_TRUE(two.some);
    ASSERT_EQ(two.notes.size(), 2U);
    EXPECT_EQ(two.notes[1].tree, 8U);
    EXPECT_EQ(two.next, begin + 2);
    constexpr size_t kOfAPublication = 220000; // 100,000 people, a tenth in groups, two notes each
    for (size_t i = 0; i < kOfAPublication; ++i) ring->post({9, 3});
    EXPECT_EQ(ring->from(begin).notes.size(), kOfAPublication + 2) << "somebody else's is found among them";
    for (size_t i = 0; i < kOfAPublication; ++i) ring->post({9, 3});
    EXPECT_FALSE(ring->from(begin).some);
    EXPECT_TRUE(ring->from(ring->position()).some);
    EXPECT_FALSE(ring->from(ring->position() + 1).some);
}

TEST(NewsRing, GivesPositionsThatNobodyElseCanMakeOrRead) {
    NewsRing* ring = NewsRing::map();
    NewsRing* other = NewsRing::map();
    ASSERT_TRUE(ring && other);
    EXPECT_EQ(ring->positionOf(ring->token(41)), 41U);
    EXPECT_NE(ring->token(41).substr(0, 16), ring->token(42).substr(0, 16));
    EXPECT_FALSE(other->positionOf(ring->token(41)));
    for (const char* wrong : {"", "0", "zz112233445566778899aabbccddeeff", "00112233445566778899aabbccddeef "})
        EXPECT_FALSE(ring->positionOf(wrong)) << wrong;
}

TEST(NewsRing, LosesNoNoteOfManyWritersAtATime) {
    NewsRing* ring = NewsRing::map();
    ASSERT_TRUE(ring);
    constexpr uint64_t kWriters = 4, kEach = 2000;
    std::vector<std::thread> writers;
    for (uint64_t w = 1; w <= kWriters; ++w)
        writers.emplace_back([=] {
            for (uint64_t i = 0; i < kEach; ++i) ring->post({i, w});
        });
    std::vector<uint64_t> seen(kWriters + 1);
    for (uint64_t next = 0; next < kWriters * kEach;) {
        const uint32_t bell = ring->bell();
        const auto got = ring->from(next);
        ASSERT_TRUE(got.some);
        for (const auto& note : got.notes) EXPECT_EQ(note.tree, seen.at(note.writer)++) << note.writer;
        if (got.notes.empty()) ring->waitForBell(bell, 1000);
        next = got.next;
    }
    for (auto& writer : writers) writer.join();
}

} // namespace
} // namespace rolvane
