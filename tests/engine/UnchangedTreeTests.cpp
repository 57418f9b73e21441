// Passes over trees and databases in which nothing has changed, and the first change after them.

#include "TwoUsers.h"

namespace rolvane::test {
namespace {

class UnchangedTrees : public TwoUsers {
protected:
    // From then on a pass finds everything as it was at a comparison that has found nothing.
    void settle() {
        for (int i = 0; i < 3; ++i)
            for (Participant* user : {&bob, &alice}) user->pass();
        for (Participant* user : {&bob, &alice}) {
            user->wire->clear();
            user->pass();
            EXPECT_EQ(user->reads("/info"), 0u) << "no short way was gone by " << user->name << "\n"
                                                << user->wire->text();
        }
        ASSERT_EQ(copies(), alice.view());
    }
    void bothPass() {
        for (Participant* user : {&alice, &bob, &alice, &bob}) user->pass();
    }
};

TEST_F(UnchangedTrees, APassAsksFiveTimesAtMost) {
    settle();
    for (Participant* user : {&alice, &bob}) {
        user->wire->clear();
        user->pass();
        EXPECT_LE(user->wire->exchanges().size(), 5u) << user->name << "\n" << user->wire->text();
    }
}

TEST_F(UnchangedTrees, AnEditIsSentWithSixRequestsAndAReadWhereOthersMayWrite) {
    settle();
    people[1]->setValue(Value("Benjamin"), kCXFirstNameProperty); // who is in no group
    alice.application->save();
    alice.wire->clear();
    ASSERT_TRUE(alice.database->deliverExternalChanges()); // as an edit comes, without a gathering
    EXPECT_EQ(alice.wire->count("PUT"), 2u) << alice.wire->text();
    EXPECT_EQ(alice.reads(""), 1u) << alice.wire->text();
    EXPECT_LE(alice.wire->exchanges().size(), 7u) << alice.wire->text();
    bob.pass();
    EXPECT_EQ(copies(), alice.view());
}

// Whoever compares a tree asks for its "info" first.
TEST_F(UnchangedTrees, AnEditThatIsReadIsComparedAlone) {
    settle();
    for (const char* name : {"Benjamin", "Benno", "Benedikt"}) {
        people[1]->setValue(Value(name), kCXFirstNameProperty);
        alice.application->save();
        ASSERT_TRUE(alice.database->deliverExternalChanges());
        for (Participant* user : {&bob, &alice, &bob, &alice}) {
            user->wire->clear();
            user->pass();
            EXPECT_EQ(user->reads("/info"), 0u) << name << ", " << user->name << "\n" << user->wire->text();
        }
        EXPECT_EQ(copies(), alice.view());
    }
}

// The contact that could not be read stands out at the next look, too, whatever else has changed by then.
TEST_F(UnchangedTrees, AnEditThatCouldNotBeReadComesLater) {
    settle();
    writeElsewhere(people[1], "Benjamin");
    bob.wire->intercept([](const HttpRequest& request) -> std::optional<HttpResponse> {
        const bool isContact = request.method == "GET" && request.url.path().find("People") != std::string::npos;
        return isContact ? std::optional(answerOf(503)) : std::nullopt;
    });
    bob.pass();
    EXPECT_NE(firstName(bob.copyOf(people[1])), Value("Benjamin"));
    writeElsewhere(people[2], "Cleopatra");
    bob.pass();
    bob.wire->intercept({});
    bob.pass();
    for (int i = 0; i < 2; ++i)
        for (Participant* user : {&alice, &bob}) user->pass();
    EXPECT_EQ(copies(), alice.view());
    EXPECT_EQ(firstName(bob.copyOf(people[1])), Value("Benjamin"));
    EXPECT_EQ(firstName(bob.copyOf(people[2])), Value("Cleopatra"));
}

// Somebody has deleted the copy meanwhile, so that the edit alone does not tell how the trees differ.
TEST_F(UnchangedTrees, AnEditOfAContactThatIsNotHereIsComparedWithAll) {
    settle();
    writeElsewhere(people[1], "Benjamin");
    bob.application->removeRecord(bob.copyOf(people[0]));
    bob.application->save();
    bob.wire->clear();
    bob.pass();
    EXPECT_GT(bob.reads("/info"), 0u) << bob.wire->text();
    for (int i = 0; i < 2; ++i) bothPass();
    EXPECT_EQ(copies(), alice.view());
}

// The cache that knows them is gone. What lies in a tree that nobody else writes to is no news, and is not read.
TEST_F(UnchangedTrees, VersionsThatAreForgottenAreNotReadAnewWhereNobodyElseWrites) {
    alice.application->allGroup()->setValue(CXMutableMultiValue(), kCXReadWriteSharingACLProperty);
    alice.application->save();
    for (int pass = 0; pass < 2; ++pass) alice.pass();
    alice.start(); // a daemon asks who may write when it begins
    alice.pass();
    for (const CXPersonRef& person : people)
        alice.manager.forgetVersion(Url(alice.base)
                                        .cxURLByAppendingComponent("People")
                                        .cxURLByAppendingComponent(CXACLManager::bucketNameForUID(person->uniqueId()))
                                        .cxURLByAppendingComponent(person->uniqueId().str()));
    alice.wire->clear();
    for (int pass = 0; pass < 2; ++pass) alice.pass();
    EXPECT_EQ(alice.reads("People"), 0u) << alice.wire->text();
    EXPECT_EQ(alice.countPeople(), people.size());
}

TEST_F(UnchangedTrees, EveryKindOfChangeArrives) {
    settle();
    writeElsewhere(people[1], "Benjamin");
    bothPass();
    EXPECT_EQ(copies(), alice.view());
    EXPECT_EQ(contentOf(fileOf(people[1]))[kCXFirstNameProperty], Value("Benjamin"));

    settle();
    alice.add("Dora");
    alice.application->save();
    bothPass();
    EXPECT_EQ(copies().size(), alice.view().size());
    EXPECT_EQ(copies(), alice.view());

    settle();
    alice.group("Colleagues", {people[1]});
    alice.application->save();
    bothPass();
    EXPECT_EQ(copies(), alice.view());

    settle();
    alice.application->removeRecord(people[2]);
    alice.application->save();
    bothPass();
    EXPECT_EQ(copies(), alice.view());
}

TEST_F(UnchangedTrees, AnEditOfTheSubscribersReachesTheOwner) {
    settle();
    const auto copy = bob.copyOf(people[0]);
    copy->setValue(Value("Adelheid"), kCXFirstNameProperty);
    bob.application->save();
    for (Participant* user : {&bob, &alice, &bob, &alice}) user->pass();
    EXPECT_EQ(copies(), alice.view());
    EXPECT_EQ(contentOf(fileOf(people[0]))[kCXFirstNameProperty], Value("Adelheid"));
}

TEST_F(UnchangedTrees, ATreeThatWasSetBackIsNoticedByItsClockAlone) {
    settle();
    setDate(world->file("dateFile"), dateOf(world->file("dateFile")) - 3600);
    log.clear();
    bob.pass();
    EXPECT_NE(log.text().find("is a copy from another time"), std::string::npos) << log.text();
}

TEST_F(UnchangedTrees, AWithdrawnTreeEndsTheSubscription) {
    bob.add("Own");
    bob.publish(); // a reason to live on
    settle();
    std::filesystem::remove_all(world->file());
    bob.pass();
    EXPECT_TRUE(copies().empty());
}

TEST_F(UnchangedTrees, TheSubscribersOwnTreeIsMadeAgainWhenItIsGone) {
    settle();
    std::filesystem::remove_all(world->file("", "bob"));
    bob.pass();
    EXPECT_TRUE(std::filesystem::is_regular_file(world->file("info", "bob")));
    EXPECT_EQ(copies(), alice.view());
}

} // namespace
} // namespace rolvane::test
