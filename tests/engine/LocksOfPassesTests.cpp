// Passes whose lock is answered badly, or that write to a store without locks.

#include "TwoUsers.h"

#include <atomic>

namespace rolvane::test {

class LocksOfPasses : public TwoUsers {
protected:
    void SetUp() override {
        for (int i = 0; i < 2; ++i) {
            alice.pass();
            bob.pass();
        }
        ASSERT_EQ(copies(), alice.view());
    }
    static HttpResponse lost() {
        HttpResponse answer;
        answer.error = TransportError::unreachable;
        return answer;
    }
    static void rename(Participant& whose, const CXPersonRef& person, const std::string& first) {
        person->setValue(Value(first), kCXFirstNameProperty);
        whose.application->save();
    }
    void expectSent(const std::string& first) {
        EXPECT_EQ(contentOf(fileOf(people[0]))[kCXFirstNameProperty], Value(first)) << alice.wire->text();
        EXPECT_TRUE(alice.engine->getPendingChanges().empty()) << alice.wire->text();
    }
    void expectNothingLocked() {
        const auto lock = makeStoreLock(bob.manager, Url(alice.base).cxURLByAppendingComponent("dateFile"));
        EXPECT_TRUE(lock->tryLock()) << alice.wire->text();
        EXPECT_TRUE(lock->locked());
        lock->unlock();
    }
    void setUpLocks(Participant& whose, int status) {
        whose.wire->intercept([status](const HttpRequest& request) {
            return request.method == "LOCK" ? std::optional(answerOf(status)) : std::nullopt;
        });
    }
};

TEST_F(LocksOfPasses, AnEditGoesOutInThePassWhoseLockWasNotHeardOf) {
    const auto wire = world->transport("alice");
    std::atomic<int> harmed{0};
    alice.wire->intercept([&](const HttpRequest& request) {
        if (request.method != "LOCK" || harmed++ > 0) return std::optional<HttpResponse>();
        EXPECT_TRUE(wire->perform(request).ok());
        return std::optional(lost());
    });
    rename(alice, people[0], "Adelheid");
    alice.pass();
    EXPECT_GT(harmed, 0);
    expectSent("Adelheid");
    expectNothingLocked();
}

TEST_F(LocksOfPasses, AnEditGoesOutInTheNextPassWhenTheStoreWentAwayBehindTheLock) {
    const auto wire = world->transport("alice");
    std::atomic<bool> isAway{false};
    alice.wire->intercept([&](const HttpRequest& request) {
        if (request.method == "LOCK" && !isAway.exchange(true)) {
            EXPECT_TRUE(wire->perform(request).ok());
        }
        return isAway ? std::optional(lost()) : std::nullopt;
    });
    rename(alice, people[0], "Adelheid");
    alice.pass();
    EXPECT_TRUE(isAway);
    alice.wire->intercept(nullptr);
    alice.pass();
    expectSent("Adelheid");
    expectNothingLocked();
}

TEST_F(LocksOfPasses, NothingStaysLockedWhereTheAnswerToTheReleaseIsLost) {
    std::atomic<int> asked{0};
    alice.wire->intercept([&](const HttpRequest& request) {
        return request.method == "UNLOCK" && asked++ == 0 ? std::optional(lost()) : std::nullopt;
    });
    rename(alice, people[0], "Adelheid");
    alice.pass();
    EXPECT_GT(asked, 0);
    expectSent("Adelheid");
    expectNothingLocked();
}

TEST_F(LocksOfPasses, AnEditGoesOutInOnePassToAStoreThatCannotLock) {
    int edit = 0;
    for (const int status : {405, 501, 404, 500, 400}) {
        setUpLocks(alice, status);
        const std::string first = "Ada " + std::to_string(++edit);
        rename(alice, people[0], first);
        alice.wire->clear();
        alice.pass();
        expectSent(first);
    }
}

TEST_F(LocksOfPasses, AnEditWaitsForALockThatSomebodyHolds) {
    const auto theirs = makeStoreLock(bob.manager, Url(alice.base).cxURLByAppendingComponent("dateFile"));
    ASSERT_TRUE(theirs->tryLock());
    rename(alice, people[0], "Adelheid");
    alice.pass();
    EXPECT_EQ(alice.engine->getPendingChanges().size(), 1u);
    theirs->unlock();
    alice.pass();
    expectSent("Adelheid");
}

// Each has read the group before the other one wrote it, and both passes write the same file.
TEST_F(LocksOfPasses, TwoWritersWithoutLocksLoseNothing) {
    for (Participant* each : {&alice, &bob}) setUpLocks(*each, 405);
    for (int round = 0; round < 5; ++round) {
        const CXPersonRef added = alice.add("Of Alice " + std::to_string(round));
        friends->addMember(added);
        alice.application->save();
        const auto copy = std::dynamic_pointer_cast<CXGroup>(
            bob.application->recordForUniqueId(cxUIDWithTableName(friends->uniqueId(), kCXSubscribedGroupTable)));
        ASSERT_TRUE(copy);
        const CXPersonRef other = bob.copyOf(people[1]);
        round % 2 == 0 ? copy->addMember(other) : copy->removeMember(other);
        bob.application->save();
        // Alice's pass is carried out between the reading and the writing of Bob's.
        const auto isGroup = [&](const HttpRequest& request) {
            return request.method == "PUT" &&
                   request.url.encodedPath().find(friends->uniqueId().str().substr(0, 36)) != std::string::npos;
        };
        std::atomic<int> met{0};
        bob.wire->intercept([&](const HttpRequest& request) {
            if (request.method == "LOCK") return std::optional(answerOf(405));
            if (isGroup(request) && met++ == 0) alice.pass();
            return std::optional<HttpResponse>();
        });
        bob.pass();
        EXPECT_GT(met, 0) << bob.wire->text();
        setUpLocks(bob, 405);
        for (int i = 0; i < 3; ++i) {
            alice.pass();
            bob.pass();
        }
        EXPECT_EQ(copies(), alice.view()) << "round " << round << "\n" << log.text();
        const auto members = friends->memberUniqueIds();
        const auto has = [&](const CXPersonRef& person) {
            return std::find(members.begin(), members.end(), person->uniqueId()) != members.end();
        };
        EXPECT_TRUE(has(added)) << round;
        EXPECT_EQ(has(people[1]), round % 2 == 0) << round;
    }
}

} // namespace rolvane::test
