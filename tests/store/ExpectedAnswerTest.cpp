#include "store/http/ExpectedAnswer.h"
#include "RecordingTransport.h"
#include "StoreWorld.h"
#include "store/locks/CXWebDAVLock.h"

#include <atomic>
#include <gtest/gtest.h>
#include <map>
#include <string>
#include <vector>

namespace rolvane {
namespace {

using namespace test;

using Headers = std::vector<std::pair<std::string, std::string>>;

const std::string kPage = "<!DOCTYPE html><html><body>Please sign in to the hotel's network.</body></html>";
const Headers kHtml = {{"content-type", "text/html; charset=utf-8"}};
const Headers kXml = {{"content-type", "application/xml"}};
const char* const kAll[] = {"OPTIONS", "PROPFIND", "GET",  "HEAD",   "PUT", "DELETE",
                            "MKCOL",   "COPY",     "MOVE", "UNLOCK", "ACL", "LOCK"};

char letterOf(AnswerVerdict verdict) {
    switch (verdict) {
    case AnswerVerdict::success: return 'S';
    case AnswerVerdict::needsProof: return 'P';
    case AnswerVerdict::graveRefusal: return 'g';
    case AnswerVerdict::refusal: return 'r';
    case AnswerVerdict::failure: return 'f';
    case AnswerVerdict::foreign: return '.';
    }
    return '?';
}

// The verdicts on one answer to each method, in the order of kAll.
std::string verdictsOn(int status, Headers headers = {}, const std::string& body = {}) {
    std::string out;
    for (const char* method : kAll) out += letterOf(verdictOn(method, answerOf(status, headers, body)));
    return out;
}

TEST(ExpectedAnswer, EachMethodHasItsOwnSuccess) {
    //                         OPTIONS PROPFIND GET HEAD PUT DELETE MKCOL COPY MOVE UNLOCK ACL LOCK
    EXPECT_EQ(verdictsOn(200), "..SSPPP..PS.");
    EXPECT_EQ(verdictsOn(201), "....SPSSSPS.");
    EXPECT_EQ(verdictsOn(202), "....PPP..P..");
    EXPECT_EQ(verdictsOn(203), "....PPP..P..");
    EXPECT_EQ(verdictsOn(204), "....SSPSSSS.");
    EXPECT_EQ(verdictsOn(206), "....PPP..P..");
    EXPECT_EQ(verdictsOn(207), ".S..fffff.f.");
    EXPECT_EQ(verdictsOn(200, {{"dav", "1, 2"}}), "S.SSPPP..PS.");
    EXPECT_EQ(verdictsOn(204, {{"dav", "1"}}), "S...SSPSSSS.");
    for (const char* classes : {"2", "3", "extended-mkcol, 2", " 1"})
        EXPECT_EQ(verdictsOn(200, {{"dav", classes}}), "S.SSPPP..PS.") << classes;
    EXPECT_EQ(verdictsOn(200, {{"dav", "x"}, {"dav", "ACCESS-control,1"}}), "S.SSPPP..PS.");
    for (const char* classes : {"", "4", "12", "access-control"})
        EXPECT_EQ(verdictsOn(200, {{"dav", classes}}), "..SSPPP..PS.") << classes;
    EXPECT_EQ(verdictsOn(200, kXml, "<multistatus xmlns=\"DAV:\"/>"), ".SSSPPP..PS.") << "which should be 207";
    const auto deleted = [](const std::string& status) {
        return verdictsOn(207, kXml,
                          "<D:multistatus xmlns:D=\"DAV:\"><D:response><D:href>/x</D:href><D:status>HTTP/1.1 " +
                              status + "</D:status></D:response></D:multistatus>");
    };
    EXPECT_EQ(deleted("200 OK"), ".S..fSfff.f.");
    EXPECT_EQ(deleted("404 Not Found"), ".S..fSfff.f.");
    EXPECT_EQ(deleted("423 Locked"), ".S..fffff.f.");
}

TEST(ExpectedAnswer, AWebPageIsNoSuccessByItself) {
    EXPECT_EQ(verdictsOn(200, kHtml, kPage), "..PPPPP..P..");
    EXPECT_EQ(verdictsOn(200, {}, kPage), "..PPPPP..P..") << "without a type it is known by its beginning";
    EXPECT_EQ(verdictsOn(207, kHtml, kPage), "....fffff...");
    EXPECT_EQ(verdictsOn(201, kHtml, kPage), "....SPSSSP..") << "httpd says \"Created\" with a page";
    EXPECT_EQ(verdictsOn(200, kXml, kPage), "..SSPPP..PS.") << "a type that says otherwise holds";
}

TEST(ExpectedAnswer, ALockIsGrantedByAnActiveLock) {
    const std::string grant = "<D:prop xmlns:D=\"DAV:\"><D:lockdiscovery><D:activelock/></D:lockdiscovery></D:prop>";
    EXPECT_EQ(verdictOn("LOCK", answerOf(200, kXml, grant)), AnswerVerdict::success);
    EXPECT_EQ(verdictOn("LOCK", answerOf(201, kXml, grant)), AnswerVerdict::success);
    EXPECT_EQ(verdictOn("LOCK", answerOf(204, kXml, grant)), AnswerVerdict::foreign);
    EXPECT_EQ(verdictOn("LOCK", answerOf(200, kHtml, "<html>activelock</html>")), AnswerVerdict::foreign);
}

TEST(ExpectedAnswer, FailuresAndForeignErrorsAreTheSameForEveryMethod) {
    const std::map<char, std::vector<int>> expected{{'f', {401, 408, 429, 500, 502, 503, 504, 507, 508, 599, 999}},
                                                    {'.', {100, 102, 199, 407, 511}}};
    for (const auto& [letter, statuses] : expected)
        for (const int status : statuses)
            for (const Headers& headers : {Headers(), kHtml, kXml})
                EXPECT_EQ(verdictsOn(status, headers, headers == kHtml ? kPage : ""), std::string(12, letter))
                    << status;
}

TEST(ExpectedAnswer, RefusalsThatSomethingFollowsFromAreGrave) {
    for (const int status : {300, 301, 302, 303, 307, 308})
        EXPECT_EQ(verdictsOn(status), std::string(12, 'g')) << status;
    //                         OPTIONS PROPFIND GET HEAD PUT DELETE MKCOL COPY MOVE UNLOCK ACL LOCK
    for (const int status : {400, 402, 403, 404, 409, 410, 411, 413, 415, 424, 451, 501})
        EXPECT_EQ(verdictsOn(status), "rrrrgggggggg") << status;
    EXPECT_EQ(verdictsOn(412), "rrrrrggggggg");
    EXPECT_EQ(verdictsOn(405), "rrrrggrggggg");
    EXPECT_EQ(verdictsOn(423), std::string(12, 'r'));
}

TEST(ExpectedAnswer, NoAnswerIsAFailureAndAnUnknownMethodHasNoSuccess) {
    HttpResponse lost;
    lost.error = TransportError::timedOut;
    for (const char* method : kAll) EXPECT_EQ(verdictOn(method, lost), AnswerVerdict::failure);
    for (const int status : {200, 201, 204, 207})
        EXPECT_EQ(verdictOn("SEARCH", answerOf(status)), AnswerVerdict::foreign);
}

// A client on a real store, before which a portal stands while `closed`.
struct PortalWorld {
    explicit PortalWorld(int portalStatus = 200, Headers headers = kHtml, std::string body = kPage) : alice(world) {
        EXPECT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true));
        EXPECT_EQ(alice.write("x", Dictionary{{"a", 1}}), 201);
        CXDAVError error;
        EXPECT_TRUE(alice.manager.canReach(error));
        alice.manager.failures().take();
        alice.wire->intercept([=, this](const HttpRequest&) -> std::optional<HttpResponse> {
            if (!closed) return std::nullopt;
            return answerOf(portalStatus, headers, body);
        });
    }
    StoreWorld world;
    Client alice;
    std::atomic<bool> closed{false};
};

TEST(Portal, WithAPageForEverythingIsNeverBelieved) {
    for (const int status : {200, 202, 302, 403, 404, 405, 407, 409, 410, 412, 501, 511}) {
        PortalWorld portal(status);
        Client& alice = portal.alice;
        auto lock = makeStoreLock(alice.manager, alice.at("dateFile"));
        ASSERT_TRUE(lock->tryLock());
        portal.closed = true;                         // the server has proven itself just now
        const int expected = status == 412 ? 412 : 0; // another version is read before anything follows
        EXPECT_EQ(alice.write("y", Dictionary{{"a", 2}}), expected) << status;
        EXPECT_EQ(alice.write("x", Dictionary{{"a", 2}}), expected) << status;
        EXPECT_FALSE(alice.read("x").second) << status;
        EXPECT_NE(alice.read("info").first, 403) << status;
        EXPECT_NE(alice.read("info").first, 404) << status;
        int code = -1;
        EXPECT_FALSE(alice.manager.removeFileAtURL(alice.at("x"), &code)) << status;
        EXPECT_EQ(code, 0) << status;
        EXPECT_FALSE(alice.manager.createDirectoryAtAURL(alice.at("z"))) << status;
        EXPECT_FALSE(alice.manager.infoForFilesInContainer(alice.base)) << status;
        EXPECT_FALSE(alice.manager.modDateForURL(alice.at("dateFile"))) << status;
        EXPECT_FALSE(alice.manager.sanityCheckPublishStructureCreate(true)) << status;
        EXPECT_FALSE(alice.manager.setACLsWithReadPrincipals({"bob"}, {}, alice.base)) << status;
        CXDAVError error;
        EXPECT_FALSE(alice.manager.canReach(error)) << status;
        lock->unlock();
        EXPECT_GE(alice.manager.failures().take().size(), 5u) << status;
        portal.closed = false;
        // Nothing is lost, nothing counts as written, and the lock that was not given back is used again.
        EXPECT_EQ(alice.read("x").second, (Dictionary{{"a", 1}})) << status;
        EXPECT_EQ(alice.read("y").first, 404) << status;
        EXPECT_EQ(alice.write("x", Dictionary{{"a", 3}}), 204) << status;
        EXPECT_TRUE(makeStoreLock(alice.manager, alice.at("dateFile"))->tryLock()) << status;
    }
}

TEST(Portal, WithoutATypeOfItsPageIsNotBelievedEither) {
    PortalWorld portal(200, {}, "Welcome! Accept the terms to go on.");
    Client& alice = portal.alice;
    portal.closed = true;
    EXPECT_EQ(alice.write("x", Dictionary{{"a", 2}}), 0);
    EXPECT_FALSE(alice.read("x").second);
    EXPECT_FALSE(alice.manager.removeFileAtURL(alice.at("x"), nullptr));
    portal.closed = false;
    EXPECT_EQ(alice.read("x").second, (Dictionary{{"a", 1}}));
}

// The server behind answers writes with 200 and a page, as some do; what it says it has done.
TEST(ExpectedAnswer, AServerThatSaysOkWithAPageIsBelievedWhenItShowsWhatItHasDone) {
    StoreWorld world;
    Client alice(world);
    const auto direct = world.transport();
    std::atomic<bool> lies{false};
    alice.wire->intercept([&](const HttpRequest& r) -> std::optional<HttpResponse> {
        const bool writes = r.method == "PUT" || r.method == "DELETE" || r.method == "MKCOL" || r.method == "UNLOCK";
        if (!writes) return std::nullopt;
        const HttpResponse answer = lies ? answerOf(200) : direct->perform(r);
        return answer.ok() ? answerOf(200, kHtml, "<html>Done.</html>") : answer;
    });
    ASSERT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true));
    EXPECT_EQ(alice.write("x", Dictionary{{"a", 1}}), 200);
    EXPECT_EQ(alice.read("x").second, (Dictionary{{"a", 1}}));
    EXPECT_TRUE(alice.manager.createDirectoryAtAURL(alice.at("d")));
    auto lock = makeStoreLock(alice.manager, alice.at("dateFile"));
    ASSERT_TRUE(lock->tryLock());
    lock->unlock();
    EXPECT_TRUE(makeStoreLock(alice.manager, alice.at("dateFile"))->tryLock());
    EXPECT_TRUE(alice.manager.removeFileAtURL(alice.at("d"), nullptr));
    EXPECT_TRUE(alice.manager.failures().take().empty());
    lies = true; // a WebDAV server that says so and has not done it
    EXPECT_EQ(alice.write("x", Dictionary{{"a", 2}}), 0);
    EXPECT_FALSE(alice.manager.createDirectoryAtAURL(alice.at("e")));
    EXPECT_FALSE(alice.manager.removeFileAtURL(alice.at("x"), nullptr));
    EXPECT_GE(alice.manager.failures().take().size(), 3u);
}

// Answers requests for "info" with the statuses of the list, one after the other, then as the store does.
struct TreeEnd {
    TreeEnd(std::vector<int> statuses, const std::string& user) : alice(world), reader(world, user) {
        EXPECT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true));
        EXPECT_TRUE(alice.manager.setACLsWithReadPrincipals({"bob"}, {}, alice.base));
        reader.wire->intercept([this, statuses](const HttpRequest& r) -> std::optional<HttpResponse> {
            if (r.method != "GET" || !r.url.encodedPath().ends_with("/info")) return std::nullopt;
            const size_t number = asked++;
            if (number >= statuses.size()) return std::nullopt;
            return answerOf(statuses[number]);
        });
    }
    StoreWorld world;
    Client alice, reader;
    std::atomic<size_t> asked{0};
};

TEST(TreeEnd, IsToldOnlyWhenTheStoreSaysItTwice) {
    const std::map<std::vector<int>, int> expected{
        {{404}, 200},      {{403, 403}, 200},      {{404, 404}, 404},          {{403, 403, 404}, 404},
        {{404, 500}, 500}, {{404, 403, 403}, 403}, {{403, 403, 403, 403}, 403}};
    for (const auto& [statuses, code] : expected) {
        TreeEnd tree(statuses, "bob");
        EXPECT_EQ(tree.reader.read("info").first, code) << testing::PrintToString(statuses);
        EXPECT_GE(tree.reader.wire->count("OPTIONS"), 1u);
    }
}

TEST(TreeEnd, IsNotToldWhenTheStoreIsNoWebDAVServerInBetween) {
    TreeEnd tree({404, 404}, "bob");
    std::atomic<int> gets{0};
    tree.reader.wire->intercept([&](const HttpRequest& r) -> std::optional<HttpResponse> {
        if (r.method == "GET") return ++gets, answerOf(404);
        if (r.method == "OPTIONS" && gets > 0) return answerOf(200); // it was one before
        return std::nullopt;
    });
    CXDAVError error;
    ASSERT_TRUE(tree.reader.manager.canReach(error));
    EXPECT_EQ(tree.reader.read("info").first, 0);
}

TEST(TreeEnd, OfTheOwnTreeIsToldAfterItsStructureWasLookedAfter) {
    TreeEnd tree({}, "alice");
    Client& owner = tree.reader;
    const auto before = owner.read("info").second;
    ASSERT_TRUE(before);
    owner.manager.keepSerialNumber((*before)["SerialNumber"].string());
    std::filesystem::remove(tree.world.file("info"));
    EXPECT_EQ(owner.read("info"), (std::pair(200, before))) << "made anew under its old number";
    TreeEnd denied({403, 403, 403, 403}, "alice");
    EXPECT_EQ(denied.reader.read("info").first, 403);
    EXPECT_GE(denied.reader.wire->count("PROPFIND"), 1u);
}

} // namespace
} // namespace rolvane
