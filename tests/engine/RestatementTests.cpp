// Changes that waited while the store was away say what was true when they were made. What the store gets with the
// first pass that reaches it is what the database says by then.

#include "TwoUsers.h"

#include "contacts/records/CXMultiValue.h"
#include "engine/recovery/UnderWay.h"
#include "model/PayloadKeys.h"

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
    void passWhileAway(bool arrives = false) { passWhileAway(alice, arrives); }
    static void passWhileAway(Participant& user, bool arrives) {
        EverybodysKeys store(*world);
        user.wire->intercept([&store, arrives](const HttpRequest& request) -> std::optional<HttpResponse> {
            if (request.method != "PUT" && request.method != "DELETE" && request.method != "MKCOL" &&
                request.method != "ACL")
                return std::nullopt;
            if (arrives) store.perform(request);
            HttpResponse failed;
            failed.status = 503;
            return failed;
        });
        user.pass();
        user.wire->intercept({});
    }
    static void passOffLine(Participant& user) {
        user.network.reachable = false;
        user.pass();
        user.network.reachable = true;
    }
    CXGroupRef copyOf(const CXGroupRef& group) {
        return std::dynamic_pointer_cast<CXGroup>(
            bob.application->recordForUniqueId(cxUIDWithTableName(group->uniqueId(), kCXSubscribedGroupTable)));
    }
    // Bob's copies and Alice's contacts are equal after a few passes, and at rest.
    void expectEqualInTheEnd() {
        for (Participant* each : {&bob, &alice, &bob, &alice, &bob}) each->pass();
        EXPECT_EQ(copies(), alice.view()) << log.text();
        for (Participant* each : {&alice, &bob}) expectQuietPass(*each);
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

// The same of a writer's, in somebody else's tree.
TEST_F(WaitedChanges, WhatAWriterHasOnTheStoreAllTheSameIsUndoneThere) {
    const CXGroupRef copy = copyOf(friends);
    copy->setValue(Value("Bob's"), kCXGroupNameProperty);
    copy->addMember(bob.copyOf(people[1]));
    copy->removeMember(bob.copyOf(people[0]));
    bob.application->save();
    passWhileAway(bob, true);
    copy->setValue(Value("Friends"), kCXGroupNameProperty);
    copy->removeMember(bob.copyOf(people[1]));
    copy->addMember(bob.copyOf(people[0]));
    bob.application->save();
    const auto meant = copies();
    expectEqualInTheEnd();
    EXPECT_EQ(copies(), meant) << log.text();
}

// Nothing of it was ever sent, so what the owner does meanwhile is news.
TEST_F(WaitedChanges, WhatAWriterHasUndoneBeforeItWasSentDoesNotUndoTheOwnersChange) {
    const CXGroupRef copy = copyOf(friends);
    copy->setValue(Value("Bob's"), kCXGroupNameProperty);
    copy->addMember(bob.copyOf(people[1]));
    bob.application->save();
    passOffLine(bob);
    copy->setValue(Value("Friends"), kCXGroupNameProperty);
    copy->removeMember(bob.copyOf(people[1]));
    bob.application->save();
    friends->setValue(Value("Alice's"), kCXGroupNameProperty);
    friends->addMember(people[1]);
    save();
    alice.pass();
    const auto meant = alice.view();
    expectEqualInTheEnd();
    EXPECT_EQ(alice.view(), meant) << log.text();
}

TEST_F(WaitedChanges, ADeletionThatAWriterTakesBackIsNotMade) {
    const CXPersonRef copy = bob.copyOf(people[1]);
    const Dictionary content = copy->dictionaryRepresentation();
    const UniqueId uid = copy->uniqueId();
    const auto meant = copies();
    bob.application->removeRecord(copy);
    bob.application->save();
    passOffLine(bob);
    const auto again = CXPerson::initWithUniqueId(uid);
    bob.application->addRecord(again);
    for (const auto& [property, value] : content) again->setValue(value, property);
    copyOf(sub)->addMember(again);
    bob.application->save();
    expectEqualInTheEnd();
    EXPECT_EQ(copies(), meant) << log.text();
}

// A killed pass has taken a name out of a group on the store, which nobody could take in yet: the disk was full. The
// group has never been in the database, so nobody has deleted it.
TEST_F(WaitedChanges, AGroupThatIsStillToBeTakenInIsNotTakenForADeletedOne) {
    const UniqueId circle = CXGroup::create()->uniqueId(), nobody = CXPerson::create()->uniqueId();
    CXRolvane& database = *alice.application;
    const auto creation =
        std::make_shared<CXDChangeRecord>(CXDSyncSourceVaultra, CXDCreateStructureForGroup, kSelf, std::nullopt, circle,
                                          Dictionary{{kCXGroupNameProperty, "Circle"}});
    creation->setAppliesToSources(CXDSyncSourceCX);
    const auto change = std::make_shared<CXDChangeRecord>(CXDSyncSourceCX, CXDCompositeGroupChange, kSelf, std::nullopt,
                                                          circle, Dictionary{{kMemberRemoves, Array{nobody}}});
    change->setAppliesToSources(CXDSyncSourceVaultra);
    const auto typesWith = [&](size_t fresh) {
        CXDChangeRecords records{creation, change->copy()};
        Dictionary data;
        settleUnderWay(underWay({change}), {kSelf, database.allGroup(), true}, records, fresh, data, database);
        std::vector<int32_t> types;
        for (const CXDChangeRecordPtr& record : records) types.push_back(record->type());
        return types;
    };
    EXPECT_EQ(typesWith(0), (std::vector<int32_t>{CXDCreateStructureForGroup, CXDCompositeGroupChange}));
    // Gathered just now it may be what a killed pass has put there itself, of a group that was deleted since.
    const auto gathered = typesWith(1);
    EXPECT_EQ(std::count(gathered.begin(), gathered.end(), CXDCreateStructureForGroup), 0);
    EXPECT_GE(std::count(gathered.begin(), gathered.end(), CXDDeleteGroup), 1);
}

} // namespace rolvane::test
