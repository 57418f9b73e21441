// The store says that the owner's tree is forbidden, gone or another one. The publication ends, and whom the owner has
// shut out meanwhile does not keep the right to read without a word.

#include "conduits/store/EndedPublication.h"

#include "TwoUsers.h"
#include "engine/memory/EngineState.h"

namespace rolvane::test {
namespace {

class EndedByTheStore : public TwoUsers {
protected:
    EndedByTheStore() {
        bob.add("Berta");
        bob.publish();
        bob.pass();
        alice.subscribe(bob); // a reason to live on, as are two subscriptions
        alice.application->addRecord(
            CXSubscription::create(RemoteLocation("published-groups"), false, "Published groups"));
        alice.application->save();
        alice.pass();
        EXPECT_EQ(bobReads(), 200);
    }
    // What the store tells Bob himself about Alice's list of everybody.
    static int bobReads() {
        Client client{*world, "bob"};
        return client.read("AllCXGroup").first;
    }
    void shutOutBob() {
        for (const char* list : {kCXReadSharingACLProperty, kCXReadWriteSharingACLProperty})
            alice.application->allGroup()->removeValueForProperty(list);
        alice.application->save();
    }
    void answerAlice(const std::function<std::optional<int>(const HttpRequest&)>& status) {
        alice.wire->intercept([status](const HttpRequest& request) -> std::optional<HttpResponse> {
            const auto code = status(request);
            if (!code) return std::nullopt;
            HttpResponse answer;
            answer.status = *code;
            answer.headers = {{"date", "Sun, 22 Nov 2026 10:00:00 GMT"}};
            return answer;
        });
    }
    static bool readsOwnInfo(const HttpRequest& request) {
        return request.method == "GET" && request.url.path().ends_with("/alice/Contacts/info");
    }
    bool isPublished() {
        return static_cast<bool>(alice.application->allGroup()->valueForProperty(kCXRemoteLocationProperty));
    }
    std::optional<EndedPublication> note() { return endedPublication(alice.preferences); }
};

TEST_F(EndedByTheStore, WhatWaitedForTheListsIsSentAndThePersonIsTold) {
    shutOutBob();
    answerAlice([](const HttpRequest& r) { return readsOwnInfo(r) ? std::optional(403) : std::nullopt; });
    alice.pass();
    EXPECT_FALSE(isPublished()) << log.text();
    EXPECT_EQ(bobReads(), 403) << "he was shut out\n" << alice.wire->text();
    EXPECT_EQ(alice.countPeople(), 3u);
    ASSERT_EQ(alice.alert.told.size(), 1u) << log.text();
    EXPECT_EQ(alice.alert.told[0].header, "Your contacts are not published any more");
    EXPECT_EQ(alice.alert.told[0].message.find("bob"), std::string::npos) << alice.alert.told[0].message;
    ASSERT_TRUE(note());
    EXPECT_FALSE(note()->replaced);
    EXPECT_TRUE(note()->mayStillRead.empty());
    alice.pass();
    EXPECT_EQ(alice.alert.told.size(), 1u) << "once";
}

TEST_F(EndedByTheStore, WhoeverCouldNotBeShutOutIsNamedAndIsShutOutOnceTheStoreTakesIt) {
    shutOutBob();
    answerAlice([](const HttpRequest& r) {
        if (r.method == "ACL") return std::optional(503);
        return readsOwnInfo(r) ? std::optional(403) : std::nullopt;
    });
    alice.pass();
    EXPECT_EQ(bobReads(), 200);
    ASSERT_EQ(alice.alert.told.size(), 1u) << log.text();
    EXPECT_NE(alice.alert.told[0].message.find("bob"), std::string::npos) << alice.alert.told[0].message;
    ASSERT_TRUE(note());
    EXPECT_EQ(note()->mayStillRead, std::vector<UserName>{UserName("bob")});

    answerAlice([](const HttpRequest&) { return std::optional<int>(); });
    alice.pass();
    EXPECT_EQ(bobReads(), 403) << alice.wire->text();
    ASSERT_TRUE(note());
    EXPECT_TRUE(note()->mayStillRead.empty());
}

TEST_F(EndedByTheStore, AnotherTreeInItsPlaceIsNotTouchedAndThePersonIsTold) {
    shutOutBob();
    rewrite(world->file("info"), PropertyList::toXML(Dictionary{{"SerialNumber", "another"}}));
    alice.wire->clear();
    alice.pass();
    EXPECT_FALSE(isPublished()) << log.text();
    for (const auto& exchange : alice.wire->exchanges()) EXPECT_NE(exchange.method, "ACL");
    ASSERT_EQ(alice.alert.told.size(), 1u) << log.text();
    EXPECT_NE(alice.alert.told[0].message.find("another publication"), std::string::npos);
    EXPECT_NE(alice.alert.told[0].message.find("bob"), std::string::npos) << alice.alert.told[0].message;
    ASSERT_TRUE(note());
    EXPECT_TRUE(note()->replaced);
    EXPECT_EQ(note()->mayStillRead, std::vector<UserName>{UserName("bob")});
}

TEST_F(EndedByTheStore, TheNoteIsThereWhenTheProcessEndsWithThePublication) {
    for (const CXSubscriptionRef& subscription : alice.application->subscriptions())
        alice.application->removeRecord(subscription);
    shutOutBob();
    answerAlice([](const HttpRequest& r) { return readsOwnInfo(r) ? std::optional(404) : std::nullopt; });
    EXPECT_THROW(alice.pass(), Ended);
    EXPECT_EQ(bobReads(), 403) << alice.wire->text();
    Preferences stored(alice.directory / "preferences.db");
    EXPECT_TRUE(endedPublication(stored));
    EXPECT_EQ(alice.alert.told.size(), 1u);
}

TEST_F(EndedByTheStore, AWithdrawalOfTheOwnersIsNoNews) {
    alice.application->allGroup()->removeValueForProperty(kCXRemoteLocationProperty);
    alice.application->save();
    std::filesystem::remove_all(world->file());
    alice.pass();
    EXPECT_TRUE(alice.alert.told.empty());
    EXPECT_FALSE(note());
}

} // namespace
} // namespace rolvane::test
