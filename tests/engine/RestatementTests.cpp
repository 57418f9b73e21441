// Changes of the owner's that waited while the store was away say what was true when they were made. What the store
// gets with the first pass that reaches it is what the database says by then.

#include "TwoUsers.h"

#include "contacts/records/CXMultiValue.h"

namespace rolvane::test {

class WaitedChanges : public TwoUsers {
protected:
    WaitedChanges() {
        for (int i = 0; i < 2; ++i) {
            bob.pass();
            alice.pass();
        }
        sub = alice.group("Sub", {people[1]});
        alice.pass();
        bob.pass();
        EXPECT_EQ(copies(), alice.view()) << log.text();
    }
    // No write succeeds, though it may have been made.
    void passWhileAway(bool arrives = false) {
        EverybodysKeys store(*world);
        alice.wire->intercept([&store, arrives](const HttpRequest& request) -> std::optional<HttpResponse> {
            if (request.method != "PUT" && request.method != "DELETE" && request.method != "MKCOL" &&
                request.method != "ACL")
                return std::nullopt;
            if (arrives) store.perform(request);
            HttpResponse failed;
            failed.status = 503;
            return failed;
        });
        alice.pass();
        alice.wire->intercept({});
    }
    // One pass of each is enough.
    void expectSentAsItIs() {
        alice.pass();
        bob.pass();
        EXPECT_EQ(copies(), alice.view()) << log.text();
        for (Participant* each : {&alice, &bob}) expectQuietPass(*each);
    }
    void save() { alice.application->save(); }

    CXGroupRef sub;
};

TEST_F(WaitedChanges, ANameIsSentAsItIsNow) {
    friends->setValue(Value("First"), kCXGroupNameProperty);
    save();
    passWhileAway();
    friends->setValue(Value("Second"), kCXGroupNameProperty);
    save();
    expectSentAsItIs();
    EXPECT_EQ(friends->name(), "Second");
}

TEST_F(WaitedChanges, AMemberWhoLeftAgainIsNotSent) {
    friends->addMember(people[1]);
    save();
    passWhileAway();
    friends->removeMember(people[1]);
    save();
    expectSentAsItIs();
}

TEST_F(WaitedChanges, AMemberWhoCameBackIsNotTakenOut) {
    friends->removeMember(people[0]);
    save();
    passWhileAway();
    friends->addMember(people[0]);
    save();
    expectSentAsItIs();
}

TEST_F(WaitedChanges, ANestingThatWasUndoneIsNotSent) {
    friends->addSubgroup(sub);
    save();
    passWhileAway();
    friends->removeSubgroup(sub);
    save();
    expectSentAsItIs();
}

TEST_F(WaitedChanges, ANestingThatWasTurnedRoundIsSentTurned) {
    friends->addSubgroup(sub);
    save();
    passWhileAway();
    friends->removeSubgroup(sub);
    save();
    sub->addSubgroup(friends);
    save();
    expectSentAsItIs();
}

// The answer was lost, and not the change.
TEST_F(WaitedChanges, WhatIsOnTheStoreAllTheSameIsUndoneThere) {
    friends->addMember(people[1]);
    friends->removeMember(people[0]);
    friends->addSubgroup(sub);
    save();
    passWhileAway(true);
    friends->removeMember(people[1]);
    friends->addMember(people[0]);
    friends->removeSubgroup(sub);
    save();
    sub->addSubgroup(friends);
    save();
    expectSentAsItIs();
}

TEST_F(WaitedChanges, ANumberThatAGroupUsesIsSentAsItIsNow) {
    const auto choose = [&](size_t which) {
        const auto phones = people[0]->multiValueForProperty(kCXPhoneProperty);
        friends->setDistributionIdentifier(phones->entries()[which].identifier, kCXPhoneProperty, people[0]);
        save();
    };
    CXMutableMultiValue phones;
    for (const char* number : {"1", "2", "3"}) phones.addValue(number, "work");
    people[0]->setValue(phones, kCXPhoneProperty);
    choose(0);
    alice.pass();
    choose(1);
    passWhileAway();
    choose(2);
    alice.pass();
    bob.pass();
    const auto copy = std::dynamic_pointer_cast<CXGroup>(
        bob.application->recordForUniqueId(cxUIDWithTableName(friends->uniqueId(), kCXSubscribedGroupTable)));
    ASSERT_TRUE(copy);
    const auto text = [](const CXGroup& group) {
        std::string all;
        for (const auto& [member, chosen] : group.distributionChoices())
            for (const auto& [property, identifier] : chosen) all += property + "/" + identifier + " ";
        return all;
    };
    EXPECT_EQ(text(*copy), text(*friends)) << log.text();
    EXPECT_NE(text(*friends), "");
    for (Participant* each : {&alice, &bob}) expectQuietPass(*each);
}

TEST_F(WaitedChanges, ARightThatWasTakenBackIsNotGranted) {
    const auto readers = [&](std::initializer_list<const char*> names) {
        CXMutableMultiValue all;
        for (const char* name : names) all.addValue(name, name);
        alice.application->allGroup()->setValue(all, kCXReadSharingACLProperty);
        save();
    };
    readers({"bob", "carol"});
    passWhileAway();
    readers({"bob"});
    alice.wire->clear();
    alice.pass();
    bob.pass();
    for (const auto& exchange : alice.wire->exchanges())
        EXPECT_TRUE(exchange.method != "ACL") << "nothing is to be granted\n" << alice.wire->text();
    EXPECT_EQ(copies(), alice.view()) << log.text();
    for (Participant* each : {&alice, &bob}) expectQuietPass(*each);
}

TEST_F(WaitedChanges, OfAGroupThatIsGoneNothingIsLeft) {
    friends->setValue(Value("First"), kCXGroupNameProperty);
    save();
    passWhileAway();
    alice.application->removeRecord(friends);
    save();
    expectSentAsItIs();
}

TEST_F(WaitedChanges, WhatWasMadeAndIsGoneLeavesNothingOnTheStore) {
    const auto dora = alice.add("Dora");
    const auto made = alice.group("Made", {dora, people[0]});
    passWhileAway();
    alice.application->removeRecord(made);
    alice.application->removeRecord(dora);
    save();
    expectSentAsItIs();
    EXPECT_FALSE(std::filesystem::exists(fileOf(dora)));
}

} // namespace rolvane::test
