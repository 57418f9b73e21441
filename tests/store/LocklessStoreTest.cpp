// Stores that keep no locks, and stores that only seem to.

#include "StoreWorld.h"
#include "store/http/RequestFailures.h"
#include "store/locks/CXWebDAVLock.h"
#include "store/locks/LockAnswers.h"
#include "store/locks/LockTokens.h"

#include <gtest/gtest.h>
#include <thread>

namespace rolvane {
namespace {

using namespace test;

class LocklessStores : public testing::Test {
protected:
    void SetUp() override { ASSERT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true)); }
    static std::shared_ptr<CXWebDAVLock> lock(Client& client) {
        return makeStoreLock(client.manager, client.at("dateFile"));
    }
    void answerLocksWith(const HttpResponse& answer) {
        alice.wire->intercept([answer](const HttpRequest& request) {
            return request.method == "LOCK" ? std::optional(answer) : std::nullopt;
        });
    }

    StoreWorld world;
    Client alice{world}, second{world};
};

TEST_F(LocklessStores, AStoreThatCannotLockNeedsNone) {
    for (const int status : {405, 501, 404, 500, 400, 415, 505}) {
        SCOPED_TRACE(status);
        Client client(world); // who knows nothing of the store
        client.wire->intercept([status](const HttpRequest& request) {
            return request.method == "LOCK" ? std::optional(answerOf(status)) : std::nullopt;
        });
        auto none = lock(client);
        EXPECT_TRUE(none->tryLock()) << client.wire->text();
        EXPECT_FALSE(none->locked());
        EXPECT_EQ(client.write("dateFile", "why"), 204);
        client.wire->clear();
        none->unlock();
        EXPECT_EQ(client.wire->methods(), "") << "there is nothing to give back";
        EXPECT_TRUE(client.manager.failures().take().empty());
    }
}

TEST_F(LocklessStores, AStoreThatTellsOfNoLocksIsNotAskedForOne) {
    alice.wire->intercept([&](const HttpRequest& request) {
        return request.method == "OPTIONS" ? std::optional(answerOf(200, {{"dav", "1, 3"}})) : std::nullopt;
    });
    CXDAVError error;
    ASSERT_TRUE(alice.manager.canReach(error)) << error.reason;
    alice.wire->clear();
    auto none = lock(alice);
    EXPECT_TRUE(none->tryLock());
    EXPECT_EQ(alice.wire->methods(), "");
    alice.wire->intercept(nullptr); // it has learnt it since
    ASSERT_TRUE(alice.manager.canReach(error)) << error.reason;
    auto mine = lock(alice);
    EXPECT_TRUE(mine->tryLock());
    EXPECT_TRUE(mine->locked());
    mine->unlock();
}

TEST_F(LocklessStores, ALockThatFailsForTheMomentIsWaitedFor) {
    HttpResponse late;
    late.error = TransportError::timedOut;
    for (const HttpResponse& answer :
         {answerOf(423), answerOf(503), answerOf(500, {{"retry-after", "5"}}), answerOf(429), answerOf(409),
          answerOf(401), answerOf(507), answerOf(502), answerOf(302, {{"location", "http://portal.example/"}}), late}) {
        SCOPED_TRACE(answer.status);
        answerLocksWith(answer);
        EXPECT_FALSE(lock(alice)->tryLock());
        const auto failures = alice.manager.failures().take();
        ASSERT_EQ(failures.size(), 1u);
        EXPECT_EQ(failures[0].status, answer.status);
    }
}

TEST_F(LocklessStores, OneOddFailureIsNotTakenForAStoreWithoutLocks) {
    for (const int status : {500, 404, 400}) {
        int asked = 0;
        alice.wire->intercept([&](const HttpRequest& request) {
            const bool isFirst = request.method == "LOCK" && ++asked == 1;
            return isFirst ? std::optional(answerOf(status)) : std::nullopt;
        });
        auto mine = lock(alice);
        EXPECT_TRUE(mine->tryLock());
        EXPECT_TRUE(mine->locked());
        EXPECT_FALSE(lock(second)->tryLock());
        mine->unlock();
    }
}

TEST_F(LocklessStores, AStoreInTroubleOrATreeThatIsNotThereIsWaitedFor) {
    alice.wire->intercept([&](const HttpRequest& request) {
        const bool isAsked = request.method == "LOCK" || request.method == "PROPFIND";
        return isAsked ? std::optional(answerOf(500)) : std::nullopt;
    });
    EXPECT_FALSE(lock(alice)->tryLock());
    alice.wire->intercept([&](const HttpRequest& request) {
        return request.method == "LOCK" ? std::optional(answerOf(404)) : std::nullopt;
    });
    int code = 0;
    ASSERT_TRUE(second.manager.removeFileAtURL(second.at("dateFile"), &code)) << code;
    EXPECT_FALSE(lock(alice)->tryLock());
}

TEST_F(LocklessStores, ALockOfSomebodyElsesIsRespectedByWhoIsToldThatThereAreNone) {
    auto theirs = lock(second);
    ASSERT_TRUE(theirs->tryLock());
    answerLocksWith(answerOf(500));
    EXPECT_FALSE(lock(alice)->tryLock());
}

TEST_F(LocklessStores, WhoHasShownItTwiceIsNotAskedAgainForAWhile) {
    answerLocksWith(answerOf(500));
    EXPECT_TRUE(lock(alice)->tryLock());
    alice.wire->clear();
    EXPECT_TRUE(lock(alice)->tryLock());
    EXPECT_EQ(alice.wire->methods(), "");
    LockTokens tokens;
    tokens.needNone("https://a/", 1600);
    EXPECT_TRUE(tokens.needsNone("https://a/", 1599));
    EXPECT_FALSE(tokens.needsNone("https://a/", 1600));
    EXPECT_FALSE(tokens.needsNone("https://b/", 1599));
}

// httpd still announces class 2, and answers 405.
class HttpdWithoutLocks : public testing::Test {
protected:
    static PrivateStoreOptions withoutLocks() {
        PrivateStoreOptions options;
        options.extraConfiguration = {
            "LoadModule allowmethods_module " + options.httpdModules + "/mod_allowmethods.so", "<Location /dav>",
            "  AllowMethods GET HEAD OPTIONS PUT DELETE PROPFIND MKCOL COPY MOVE", "</Location>"};
        return options;
    }
    StoreWorld world{withoutLocks()};
    Client alice{world}, second{world};
};

TEST_F(HttpdWithoutLocks, IsWrittenWithoutLocks) {
    ASSERT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true)) << alice.wire->text();
    auto none = makeStoreLock(alice.manager, alice.at("dateFile"));
    EXPECT_TRUE(none->tryLock()) << alice.wire->text();
    EXPECT_FALSE(none->locked());
    EXPECT_EQ(alice.write("dateFile", "why"), 204) << alice.wire->text();
    none->unlock();
    EXPECT_EQ(alice.wire->count("LOCK"), 1u) << alice.wire->text();
}

TEST_F(HttpdWithoutLocks, OneOfTwoWritersOfOneVersionIsTold) {
    ASSERT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true)) << alice.wire->text();
    ASSERT_EQ(alice.write("A:CXGroup", Dictionary{{"name", "first"}}), 201);
    ASSERT_EQ(alice.read("A:CXGroup").first, 200);
    int code = 0;
    std::thread([&] { // a version is known to the thread that has read it
        ASSERT_EQ(second.read("A:CXGroup").first, 200);
        code = second.write("A:CXGroup", Dictionary{{"name", "second"}});
    })
        .join();
    EXPECT_EQ(code, 204);
    EXPECT_EQ(alice.write("A:CXGroup", Dictionary{{"name", "third"}}), 412);
    EXPECT_EQ((*alice.read("A:CXGroup").second)["name"].string(), "second");
}

} // namespace
} // namespace rolvane
