// Requests about locks that the store carries out and whose answers do not come, or not whole.

#include "StoreWorld.h"
#include "foundation/Paths.h"
#include "store/http/RequestFailures.h"
#include "store/locks/CXWebDAVLock.h"

#include <filesystem>
#include <functional>
#include <gtest/gtest.h>

namespace rolvane {
namespace {

using namespace test;

HttpResponse failed(TransportError error) {
    HttpResponse answer;
    answer.error = error;
    return answer;
}
// The first one was carried out on a connection that then ended.
HttpResponse toTheSecondSending(HttpResponse answer) {
    answer.sentTwice = true;
    return answer;
}

// How the answer to a request that the store has carried out comes to harm.
struct Harm {
    const char* name;
    std::function<HttpResponse(HttpResponse)> done;
};
const std::vector<Harm> kHarms{
    {"lost", [](const HttpResponse&) { return failed(TransportError::unreachable); }},
    {"late", [](const HttpResponse&) { return failed(TransportError::timedOut); }},
    {"truncated", [](const HttpResponse&) { return failed(TransportError::truncated); }},
    {"aborted", [](const HttpResponse&) { return failed(TransportError::aborted); }},
    {"cut in the body",
     [](HttpResponse answer) {
         answer.body.resize(answer.body.size() / 2);
         return answer;
     }},
    {"without a body",
     [](HttpResponse answer) {
         answer.body.clear();
         return answer;
     }},
    {"a page in its place",
     [](const HttpResponse&) {
         return answerOf(200, {{"content-type", "text/html"}}, "<html><body>Welcome</body></html>");
     }},
    {"lost by a gateway", [](const HttpResponse&) { return answerOf(502); }},
    {"too late for a gateway", [](const HttpResponse&) { return answerOf(504); }},
    {"an error after all", [](const HttpResponse&) { return answerOf(500); }},
    {"too busy for the second sending", [](const HttpResponse&) { return toTheSecondSending(answerOf(503)); }},
    {"no connection for the second sending",
     [](const HttpResponse&) { return toTheSecondSending(failed(TransportError::refused)); }},
};

class LostLockAnswers : public testing::Test {
protected:
    void SetUp() override { ASSERT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true)); }
    static std::shared_ptr<CXWebDAVLock> lock(Client& client) {
        return makeStoreLock(client.manager, client.at("dateFile"));
    }
    // The first `times` requests of the method are carried out, and their answers harmed.
    void harm(const std::string& method, const Harm& harm, int times = 1) {
        _left = times;
        alice.wire->intercept([this, method, harm](const HttpRequest& request) {
            if (request.method != method || _left-- <= 0) return std::optional<HttpResponse>();
            return std::optional(harm.done(wire->perform(request)));
        });
    }
    // Nothing is answered any more; what is in `carriedOut` is carried out all the same.
    void loseEverything(const std::string& carriedOut = {}) {
        alice.wire->intercept([this, carriedOut](const HttpRequest& request) {
            if (request.method == carriedOut) wire->perform(request);
            return std::optional(failed(TransportError::unreachable));
        });
    }
    void restore() { alice.wire->intercept(nullptr); }
    void expectNothingLocked() {
        auto other = lock(second);
        EXPECT_TRUE(other->tryLock()) << alice.wire->text();
        other->unlock();
        const auto locks = std::filesystem::path(stateDirectory()) / "locks";
        EXPECT_TRUE(std::filesystem::is_empty(locks));
    }

    StoreWorld world;
    Client alice{world}, second{world};
    std::shared_ptr<CurlTransport> wire = world.transport();

private:
    int _left = 0; // answers to be harmed
};

TEST_F(LostLockAnswers, ALockWhoseAnswerComesToHarmIsHadAtOnce) {
    for (const Harm& each : kHarms) {
        SCOPED_TRACE(each.name);
        harm("LOCK", each);
        auto mine = lock(alice);
        ASSERT_TRUE(mine->tryLock()) << alice.wire->text();
        EXPECT_TRUE(mine->locked());
        EXPECT_NEAR(mine->expires().secondsSince(Clock::system().now()), CXWebDAVLock::lockTimeout(), 5);
        EXPECT_EQ(alice.write("dateFile", "why"), 204) << "the token is known";
        EXPECT_FALSE(lock(second)->tryLock());
        EXPECT_TRUE(mine->renew());
        mine->unlock();
        EXPECT_TRUE(alice.manager.failures().take().empty()) << "nobody's operation failed";
        expectNothingLocked();
    }
}

TEST_F(LostLockAnswers, TheNextAttemptHasTheLockAlsoWhenTheStoreCouldNotBeAskedForItFirst) {
    loseEverything("LOCK");
    EXPECT_FALSE(lock(alice)->tryLock());
    const auto failures = alice.manager.failures().take();
    ASSERT_EQ(failures.size(), 1u);
    EXPECT_EQ(failures[0].method, "LOCK");
    EXPECT_EQ(failures[0].error, TransportError::unreachable);
    restore();
    EXPECT_EQ(second.write("dateFile", "who"), 423) << "it stands";
    auto next = lock(alice);
    ASSERT_TRUE(next->tryLock()) << alice.wire->text();
    EXPECT_EQ(alice.write("dateFile", "why"), 204);
    next->unlock();
    expectNothingLocked();
}

TEST_F(LostLockAnswers, ALockThatNobodyAsksForAgainIsGivenBackAtTheEndOfThePass) {
    auto mine = lock(alice);
    loseEverything("LOCK");
    EXPECT_FALSE(mine->tryLock());
    restore();
    mine->unlock();
    expectNothingLocked();
}

TEST_F(LostLockAnswers, ALockThatCouldNotBeGivenBackIsGivenBackBeforeTheNextPass) {
    auto mine = lock(alice);
    loseEverything("LOCK");
    EXPECT_FALSE(mine->tryLock());
    mine->unlock();
    restore();
    EXPECT_EQ(second.write("dateFile", "who"), 423);
    releaseLocksOfEndedRuns(alice.manager);
    expectNothingLocked();
    alice.wire->clear();
    releaseLocksOfEndedRuns(alice.manager);
    EXPECT_EQ(alice.wire->methods(), "") << "nothing is left behind any more";
}

// The request is on its way when the store is asked what stands, and is carried out afterwards.
TEST_F(LostLockAnswers, ALockThatIsGrantedLateIsFoundByTheNextAttempt) {
    std::vector<HttpRequest> late;
    alice.wire->intercept([&](const HttpRequest& request) {
        if (request.method != "LOCK") return std::optional<HttpResponse>();
        late.push_back(request);
        return std::optional(failed(TransportError::timedOut));
    });
    auto mine = lock(alice);
    EXPECT_FALSE(mine->tryLock());
    mine->unlock();
    restore();
    ASSERT_FALSE(late.empty());
    EXPECT_TRUE(wire->perform(late.front()).ok());
    auto next = lock(alice);
    ASSERT_TRUE(next->tryLock()) << alice.wire->text();
    next->unlock();
    expectNothingLocked();
}

TEST_F(LostLockAnswers, ARequestThatIsLostOnItsWayIsSentOnceMore) {
    int lost = 0;
    alice.wire->intercept([&](const HttpRequest& request) {
        const bool isFirst = request.method == "LOCK" && ++lost == 1;
        return isFirst ? std::optional(failed(TransportError::unreachable)) : std::nullopt;
    });
    auto mine = lock(alice);
    EXPECT_TRUE(mine->tryLock()) << alice.wire->text();
    mine->unlock();
    expectNothingLocked();
}

// The transport repeats what an old connection has lost; the first one may have been carried out.
TEST_F(LostLockAnswers, ALockThatWasAskedForTwiceIsHad) {
    alice.wire->intercept([&](const HttpRequest& request) {
        if (request.method != "LOCK" || !request.body) return std::optional<HttpResponse>();
        wire->perform(request);
        return std::optional(wire->perform(request));
    });
    auto mine = lock(alice);
    ASSERT_TRUE(mine->tryLock()) << alice.wire->text();
    EXPECT_EQ(alice.write("dateFile", "why"), 204);
    mine->unlock();
    restore();
    expectNothingLocked();
}

TEST_F(LostLockAnswers, SomebodyElsesLockIsNotTakenForTheOneWhoseAnswerWasLost) {
    auto theirs = lock(second);
    ASSERT_TRUE(theirs->tryLock());
    for (const Harm& each : kHarms) {
        SCOPED_TRACE(each.name);
        harm("LOCK", each, 2);
        auto mine = lock(alice);
        EXPECT_FALSE(mine->tryLock());
        mine->unlock();
        EXPECT_TRUE(theirs->renew()) << "it is still theirs";
    }
    restore();
    theirs->unlock();
    EXPECT_TRUE(lock(alice)->tryLock());
}

TEST_F(LostLockAnswers, ALockIsGivenBackThoughTheAnswerToThatIsLost) {
    for (const bool carriedOut : {true, false}) {
        auto mine = lock(alice);
        ASSERT_TRUE(mine->tryLock());
        int asked = 0;
        alice.wire->intercept([&](const HttpRequest& request) {
            if (request.method != "UNLOCK" || ++asked > 1) return std::optional<HttpResponse>();
            if (carriedOut) wire->perform(request);
            return std::optional(failed(TransportError::unreachable));
        });
        mine->unlock();
        restore();
        expectNothingLocked();
    }
}

TEST_F(LostLockAnswers, ALockThatCouldNotBeReleasedIsReleasedBeforeTheNextPass) {
    auto mine = lock(alice);
    ASSERT_TRUE(mine->tryLock());
    loseEverything();
    mine->unlock();
    restore();
    EXPECT_EQ(second.write("dateFile", "who"), 423);
    releaseLocksOfEndedRuns(alice.manager);
    expectNothingLocked();
}

// Something in between says so, or the store is wrong for a moment: only a look tells whether the lock is gone.
TEST_F(LostLockAnswers, ARefusedReleaseThatReleasedNothingIsMadeAgainBeforeTheNextPass) {
    for (const int status : {400, 403, 404, 409, 410, 412, 423, 507}) {
        SCOPED_TRACE(status);
        auto mine = lock(alice);
        ASSERT_TRUE(mine->tryLock());
        alice.wire->intercept([&](const HttpRequest& request) {
            return request.method == "UNLOCK" ? std::optional(answerOf(status)) : std::nullopt;
        });
        mine->unlock();
        restore();
        EXPECT_EQ(second.write("dateFile", "who"), 423);
        releaseLocksOfEndedRuns(alice.manager);
        expectNothingLocked();
    }
}

TEST_F(LostLockAnswers, ALockWhoseRenewalWasRefusedAndThatStandsAllTheSameIsTakenAgain) {
    for (const int status : {404, 409, 410, 412}) {
        SCOPED_TRACE(status);
        auto mine = lock(alice);
        ASSERT_TRUE(mine->tryLock());
        alice.wire->intercept([&](const HttpRequest& request) {
            return request.method == "LOCK" ? std::optional(answerOf(status)) : std::nullopt;
        });
        EXPECT_FALSE(mine->renew());
        EXPECT_FALSE(lock(alice)->tryLock()) << "by the same answer to whoever comes next";
        restore();
        auto next = lock(alice);
        EXPECT_TRUE(next->tryLock());
        next->unlock();
        expectNothingLocked();
    }
}

TEST_F(LostLockAnswers, ALockIsRenewedThoughTheAnswerToThatIsLostOnce) {
    auto mine = lock(alice);
    ASSERT_TRUE(mine->tryLock());
    for (const Harm& each : {kHarms[0], kHarms[1], kHarms[2]}) {
        SCOPED_TRACE(each.name);
        harm("LOCK", each);
        EXPECT_TRUE(mine->renew());
    }
    mine->unlock();
    expectNothingLocked();
}

TEST_F(LostLockAnswers, APageIsNoRenewal) {
    auto mine = lock(alice);
    ASSERT_TRUE(mine->tryLock());
    alice.wire->intercept([](const HttpRequest&) {
        return std::optional(answerOf(200, {}, "<?xml version=\"1.0\"?><html><body>Welcome</body></html>"));
    });
    EXPECT_FALSE(mine->renew());
    restore();
    releaseLocksOfEndedRuns(alice.manager);
    expectNothingLocked();
}

} // namespace
} // namespace rolvane
