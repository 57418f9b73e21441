// A subscription that ends and is made anew before the daemon has looked: another program may do both in one breath,
// and a crash may lie between the two.

#include "TwoUsers.h"

namespace rolvane::test {

class Resubscribing : public TwoUsers {
protected:
    Resubscribing() {
        bob.add("Own");
        bob.publish();
        bob.pass();
        bob.pass();
    }
    void unsubscribe() {
        const RemoteLocation location(alice.base);
        bob.application->removeRecord(bob.application->findSubscriptionWithRemoteLocation(location));
        bob.application->save();
    }
    void subscribeAnew() {
        unsubscribe();
        bob.subscribe(alice);
    }
    size_t writesToAlicesTree() const {
        size_t count = 0;
        for (const auto& exchange : bob.wire->exchanges()) {
            const bool reads = exchange.method == "PROPFIND" || exchange.method == "GET" ||
                               exchange.method == "OPTIONS" || exchange.method == "HEAD" || exchange.method == "REPORT";
            count += !reads && exchange.path.find("/alice/") != std::string::npos;
        }
        return count;
    }
    template <class Moment>
    void subscribeAnewDuringAPassAt(Moment&& moment) {
        std::atomic<bool> once = true;
        bob.wire->intercept([&](const HttpRequest& request) -> std::optional<HttpResponse> {
            if (moment(request) && once.exchange(false)) subscribeAnew();
            return std::nullopt;
        });
        bob.pass();
        ASSERT_FALSE(once);
        bob.wire->clear();
        bob.pass();
        bob.database->deliverExternalChanges();
        bob.pass();
        expectEverythingHereAgainAndNothingWritten();
        bob.wire->intercept({});
    }
    void expectEverythingHereAgainAndNothingWritten() {
        EXPECT_EQ(copies(), alice.view()) << log.text();
        EXPECT_EQ(writesToAlicesTree(), 0u) << bob.wire->text();
        alice.pass();
        EXPECT_EQ(alice.countPeople(), 3u) << "the copies' absence was carried to their publisher\n" << log.text();
        EXPECT_TRUE(bob.engine->getPendingChanges().empty());
        expectQuietPass(bob);
    }
};

TEST_F(Resubscribing, WhileNoDaemonRunsTakesNothingFromThePublisher) {
    bob.engine.reset();
    subscribeAnew();
    bob.start();
    bob.wire->clear();
    bob.pass();
    expectEverythingHereAgainAndNothingWritten();
}

TEST_F(Resubscribing, BeforeAResidentDaemonsPassTakesNothingFromThePublisher) {
    subscribeAnew();
    bob.wire->clear();
    bob.pass();
    bob.database->deliverExternalChanges();
    expectEverythingHereAgainAndNothingWritten();
}

TEST_F(Resubscribing, ToldInOneNotificationBringsEverythingWithTheNextPass) {
    subscribeAnew();
    bob.wire->clear();
    bob.database->deliverExternalChanges();
    bob.pass();
    expectEverythingHereAgainAndNothingWritten();
}

TEST_F(Resubscribing, ToWhatCouldNeverBeReadIsNoRevokedSubscription) {
    unsubscribe();
    bob.database->deliverExternalChanges();
    std::atomic<bool> broken = true;
    bob.wire->intercept([&](const HttpRequest& request) {
        return broken && request.method == "PROPFIND" && request.url.encodedPath().find("/alice/") != std::string::npos
                   ? std::optional(answerOf(500))
                   : std::nullopt;
    });
    bob.subscribe(alice);
    bob.pass();
    unsubscribe();
    bob.database->deliverExternalChanges();
    broken = false;
    bob.subscribe(alice);
    bob.wire->clear();
    bob.pass();
    bob.pass();
    expectEverythingHereAgainAndNothingWritten();
}

// The journal's entries are then older than the last sync: they are delivered behind the pass that has brought the
// copies again.
TEST_F(Resubscribing, DuringAPassTakesNothingFromThePublisher) {
    // of a group or its access list: asked when the own changes have been gathered already
    subscribeAnewDuringAPassAt([](const HttpRequest& request) {
        return request.method == "PROPFIND" && request.url.path().find("CXGroup") != std::string::npos &&
               request.url.path().find("/alice/") != std::string::npos;
    });
}

TEST_F(Resubscribing, WhileAPassOpensTakesNothingFromThePublisher) {
    subscribeAnewDuringAPassAt([](const HttpRequest& request) { return request.method == "OPTIONS"; });
}

TEST_F(Resubscribing, DropsTheChangesThatWaitedForTheFormerSubscription) {
    std::atomic<bool> broken = true;
    bob.wire->intercept([&](const HttpRequest& request) {
        return broken && request.method == "PUT" && request.url.encodedPath().find("/alice/") != std::string::npos
                   ? std::optional(answerOf(500))
                   : std::nullopt;
    });
    bob.copyOf(people[0])->setValue(Value("Adelheid"), kCXFirstNameProperty);
    bob.application->save();
    bob.pass();
    ASSERT_FALSE(bob.engine->getPendingChanges().empty());
    broken = false;
    subscribeAnew();
    bob.wire->clear();
    bob.pass();
    EXPECT_EQ(firstName(bob.copyOf(people[0])), Value("Ada"));
    expectEverythingHereAgainAndNothingWritten();
}

} // namespace rolvane::test
