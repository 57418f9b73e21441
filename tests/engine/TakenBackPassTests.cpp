// Passes whose writes have reached the store and not the disk, as when the daemon is killed before it can put down what
// it did. Meanwhile either user goes on editing.

#include "TwoUsers.h"
#include "Writes.h"
#include "foundation/CXException.h"
#include "model/PayloadKeys.h"

namespace rolvane::test {

class TakenBackPass : public TwoUsers {
protected:
    TakenBackPass() {
        for (int i = 0; i < 2; ++i) {
            bob.pass();
            alice.pass();
        }
    }
    ~TakenBackPass() override { interceptWrites(nullptr); }

    static constexpr const char* kAtTheEnd = "/dateFile"; // when all is written
    // From its first write to the store on nothing reaches the disk; then a new daemon. `first`: a part of that write's
    // path. `answer`: in the place of the store's.
    void passThatIsTakenBack(Participant& user, const std::string& first = "", int answer = 0) {
        ends = false;
        user.wire->intercept([&](const HttpRequest& request) {
            const std::string path = request.url.encodedPath();
            const bool isClock = path.ends_with("dateFile");
            const bool isIt = request.method == "PUT" && path.find(first) != std::string::npos &&
                              (first.empty() ? !isClock : first == kAtTheEnd || (!isClock && !path.ends_with("/info")));
            if (isIt) ends = true;
            return isIt && answer != 0 ? std::optional(answerOf(answer)) : std::nullopt;
        });
        interceptWrites([] { return !ends.load(); });
        try {
            user.pass();
        } catch (const CXException&) { // so it ends
        }
        interceptWrites(nullptr);
        EXPECT_TRUE(ends) << "nothing was written\n" << log.text();
        user.wire->intercept({});
        user.start();
    }
    void settle() {
        for (Participant* each : {&alice, &bob, &alice, &bob, &alice, &bob}) each->pass();
        EXPECT_EQ(copies(), alice.view()) << log.text();
        for (Participant* each : {&alice, &bob}) expectQuietPass(*each);
    }
    // Bob makes it in Alice's tree.
    CXPersonRef addToAlices(const std::string& first) {
        const auto person =
            CXPerson::initWithUniqueId(cxUIDWithTableName(CXPerson::create()->uniqueId(), kCXSubscribedPersonTable));
        place(*person);
        bob.application->addRecord(person);
        person->setValue(Value(first), kCXFirstNameProperty);
        bob.application->save();
        return person;
    }
    CXGroupRef groupInAlices(const std::string& name) {
        const auto group =
            CXGroup::initWithUniqueId(cxUIDWithTableName(CXGroup::create()->uniqueId(), kCXSubscribedGroupTable));
        place(*group);
        bob.application->addRecord(group);
        group->setValue(Value(name), kCXGroupNameProperty);
        bob.application->save();
        return group;
    }
    void place(CXRecord& record) {
        CXMutableMultiValue location;
        location.addValue(alice.base, kCXSubscribeLabel);
        record.setValue(location, kCXRemoteLocationProperty);
    }
    void rename(Participant& user, const CXRecordRef& group, const char* name) {
        group->setValue(Value(name), kCXGroupNameProperty);
        user.application->save();
    }
    void remove(Participant& user, const CXRecordRef& record) {
        user.application->removeRecord(record);
        user.application->save();
    }
    CXRecordRef copyOf(const CXRecordRef& record, std::string_view table) {
        return bob.application->recordForUniqueId(cxUIDWithTableName(record->uniqueId(), table));
    }
    CXGroupRef groupCopy() { return std::dynamic_pointer_cast<CXGroup>(copyOf(friends, kCXSubscribedGroupTable)); }
    bool isMember(const CXPersonRef& person) {
        const auto members = friends->memberUniqueIds();
        return std::find(members.begin(), members.end(), person->uniqueId()) != members.end();
    }
    void refuseFileOf(const UniqueId& record) {
        bob.wire->intercept([part = record.str().substr(0, 36)](const HttpRequest& request) {
            const bool isIt = request.method == "PUT" && request.url.encodedPath().find(part) != std::string::npos;
            return isIt ? std::optional(answerOf(500)) : std::nullopt;
        });
    }
    // Bob's list of everybody names the record, the store refuses its file, and a week goes by.
    void leaveHalf(const UniqueId& record) {
        refuseFileOf(record);
        bob.pass();
        bob.wire->intercept({});
        const auto isListed = [&] {
            const Dictionary list = contentOf(world->file("AllCXGroup"));
            const char* kind = record.endsWith(kCXGroupTable) ? kSubgroupUIDState : kMemberUIDState;
            return list[kind].array().containsString(record.str());
        };
        ASSERT_TRUE(isListed()) << log.text();
        alice.pass();
        alice.clock.ahead = bob.clock.ahead = 8.0 * 86400;
        for (int round = 0; isListed() && round < 2; ++round) alice.pass();
        ASSERT_FALSE(isListed()) << log.text();
    }
    bool isOnTheStore(const UniqueId& person) { return std::filesystem::exists(fileOf(cxNormalizedUID(person))); }

    static inline std::atomic<bool> ends = false;
};

TEST_F(TakenBackPass, AContactThatAWriterDeletesBehindItStaysDeleted) {
    const CXPersonRef dora = addToAlices("Dora");
    passThatIsTakenBack(bob, "/AllCXGroup");
    ASSERT_TRUE(isOnTheStore(dora->uniqueId())) << log.text();
    remove(bob, dora);
    settle();
    EXPECT_FALSE(isOnTheStore(dora->uniqueId()));
    EXPECT_EQ(alice.countPeople(), 3u);
}

TEST_F(TakenBackPass, AContactThatItsOwnerDeletesBehindItStaysDeleted) {
    const CXPersonRef dora = alice.add("Dora");
    passThatIsTakenBack(alice, "/AllCXGroup");
    ASSERT_TRUE(isOnTheStore(dora->uniqueId())) << log.text();
    remove(alice, dora);
    settle();
    EXPECT_FALSE(isOnTheStore(dora->uniqueId()));
    EXPECT_EQ(bob.countPeople(alice.base), 3u);
}

// Nobody remembers that the store has the new contact, and somebody else has edited it there since.
TEST_F(TakenBackPass, AnEditOfTheNewContactByTheOtherUserIsKept) {
    for (Participant* maker : {&alice, &bob}) {
        SCOPED_TRACE(maker->name);
        const CXPersonRef made = maker == &alice ? alice.add("Dora") : addToAlices("Emil");
        passThatIsTakenBack(*maker, "/AllCXGroup");
        const std::filesystem::path file = fileOf(cxNormalizedUID(made->uniqueId()));
        ASSERT_TRUE(std::filesystem::exists(file)) << log.text();
        Dictionary content = contentOf(file).mutableCopy();
        content.set(kCXFirstNameProperty, "Elsewhere");
        content.set(kCXOrganizationProperty, "Company");
        rewrite(file, PropertyList::toXML(content));
        made->setValue(Value("A note"), kCXNoteProperty);
        maker->application->save();
        settle();
        EXPECT_EQ(firstName(made), Value("Elsewhere")) << log.text();
        EXPECT_EQ(made->valueForProperty(kCXOrganizationProperty), Value("Company"));
        EXPECT_EQ(made->valueForProperty(kCXNoteProperty), Value("A note"));
    }
}

TEST_F(TakenBackPass, ANumberThatIsReplacedBehindItDoesNotStandBesideItsSuccessor) {
    const CXPersonRef dora = alice.add("Dora", "11");
    passThatIsTakenBack(alice, "/AllCXGroup");
    CXMutableMultiValue phones;
    phones.addValue("22", "work");
    dora->setValue(phones, kCXPhoneProperty);
    alice.application->save();
    settle();
    const auto after = dora->multiValueForProperty(kCXPhoneProperty);
    ASSERT_TRUE(after);
    ASSERT_EQ(after->count(), 1u) << log.text();
    EXPECT_EQ(after->valueAtIndex(0), Value("22"));
}

// What the pass has written is the person's own, and no change of somebody else's.
TEST_F(TakenBackPass, AnEditThatIsTakenBackBehindItIsTakenFromTheStore) {
    const auto set = [&](const char* phone, const char* nickname) {
        CXMutableMultiValue phones;
        if (*phone) phones.addValue(Value(phone), "home", "P");
        people[0]->setValue(phones, kCXPhoneProperty);
        people[0]->setValue(Value(nickname), kCXNicknameProperty);
        alice.application->save();
    };
    set("11", "Countess");
    settle();
    set("22", "Duchess");
    passThatIsTakenBack(alice);
    ASSERT_EQ(contentOf(fileOf(people[0]))[kCXNicknameProperty], Value("Duchess"));
    bob.pass();
    bob.copyOf(people[0])->setValue(Value("Engine"), kCXOrganizationProperty);
    bob.application->save();
    bob.pass();
    set("", "Queen");
    settle();
    EXPECT_FALSE(people[0]->multiValueForProperty(kCXPhoneProperty)->count()) << log.text();
    EXPECT_EQ(people[0]->valueForProperty(kCXNicknameProperty), Value("Queen"));
    EXPECT_EQ(people[0]->valueForProperty(kCXOrganizationProperty), Value("Engine"));
    EXPECT_EQ(contentOf(fileOf(people[0]))[kCXNicknameProperty], Value("Queen"));
    EXPECT_TRUE(alice.database->conflicts().empty() && bob.database->conflicts().empty());
}

TEST_F(TakenBackPass, ANameThatTheOwnerTakesBackIsTakenFromTheStore) {
    rename(alice, friends, "Renamed");
    passThatIsTakenBack(alice);
    rename(alice, friends, "Friends");
    settle();
    EXPECT_EQ(friends->name(), "Friends") << log.text();
}

TEST_F(TakenBackPass, ANameThatSomebodyElseGivesBehindItStays) {
    rename(alice, friends, "Renamed");
    passThatIsTakenBack(alice);
    rename(alice, friends, "Friends");
    bob.pass();
    rename(bob, copyOf(friends, kCXSubscribedGroupTable), "Bob's");
    bob.pass();
    settle();
    EXPECT_EQ(friends->name(), "Bob's") << log.text();
}

// Nobody has taken the name back that the pass wrote, which Bob has seen.
TEST_F(TakenBackPass, ANameThatSomebodyElseGivesInThePlaceOfItsOwnStays) {
    rename(alice, friends, "Renamed");
    passThatIsTakenBack(alice);
    bob.pass();
    const CXRecordRef copy = copyOf(friends, kCXSubscribedGroupTable);
    ASSERT_EQ(copy->valueForProperty(kCXGroupNameProperty), Value("Renamed"));
    rename(bob, copy, "Bob's");
    bob.pass();
    settle();
    EXPECT_EQ(friends->name(), "Bob's") << log.text();
}

TEST_F(TakenBackPass, ANewGroupKeepsTheNameThatItIsGivenBehindIt) {
    const CXGroupRef crew = alice.group("Crew", {people[1]});
    passThatIsTakenBack(alice, "/AllCXGroup");
    rename(alice, crew, "Band");
    settle();
    EXPECT_EQ(crew->name(), "Band") << log.text();
}

// Nobody has taken back what the pass wrote, and to Alice's daemon the group is still one that the store has to get.
TEST_F(TakenBackPass, ANewGroupKeepsTheNameThatSomebodyElseGivesBehindIt) {
    const CXGroupRef crew = alice.group("Crew", {people[1]});
    passThatIsTakenBack(alice, kAtTheEnd);
    bob.pass();
    const CXRecordRef copy = copyOf(crew, kCXSubscribedGroupTable);
    ASSERT_TRUE(copy) << log.text();
    rename(bob, copy, "Bob's");
    bob.pass();
    const auto nameThere = [&] { return contentOf(world->file(crew->uniqueId().str()))[kCXGroupNameProperty]; };
    ASSERT_EQ(nameThere(), Value("Bob's")) << log.text();
    passThatIsTakenBack(alice, crew->uniqueId().str().substr(0, 36));
    EXPECT_EQ(nameThere(), Value("Bob's")) << log.text();
    ASSERT_EQ(crew->name(), "Crew") << log.text();
    settle();
    EXPECT_EQ(crew->name(), "Bob's") << log.text();
}

// The name that the first pass wrote is nobody else's, though the second one has put down another.
TEST_F(TakenBackPass, ANameThatWaitsGivesWayToNoEarlierOneOfItsOwn) {
    bob.pass();
    rename(bob, groupCopy(), "First");
    passThatIsTakenBack(bob, kAtTheEnd);
    rename(bob, groupCopy(), "Second");
    refuseFileOf(friends->uniqueId());
    bob.pass();
    bob.wire->intercept({});
    settle();
    EXPECT_EQ(friends->name(), "Second") << log.text();
}

// The second of the two passes has seen on the store what the first had written.
TEST_F(TakenBackPass, AMemberWhomItsOwnerTakesOutBehindTwoOfThemStaysOut) {
    bob.pass();
    groupCopy()->addMember(bob.copyOf(people[1]));
    bob.application->save();
    passThatIsTakenBack(bob, kAtTheEnd);
    alice.pass();
    ASSERT_TRUE(isMember(people[1])) << log.text();
    passThatIsTakenBack(bob, kAtTheEnd);
    friends->removeMember(people[1]);
    alice.application->save();
    alice.pass();
    settle();
    EXPECT_FALSE(isMember(people[1])) << log.text();
}

TEST_F(TakenBackPass, AMemberWhomItsOwnerPutsInAgainBehindTwoOfThemStaysIn) {
    bob.pass();
    groupCopy()->removeMember(bob.copyOf(people[2]));
    bob.application->save();
    passThatIsTakenBack(bob, kAtTheEnd);
    alice.pass();
    ASSERT_FALSE(isMember(people[2])) << log.text();
    passThatIsTakenBack(bob, kAtTheEnd);
    friends->addMember(people[2]);
    alice.application->save();
    alice.pass();
    settle();
    EXPECT_TRUE(isMember(people[2])) << log.text();
}

TEST_F(TakenBackPass, AGroupThatItsOwnerTakesOutBehindTwoOfThemStaysOut) {
    const CXGroupRef crew = alice.group("Crew", {people[1]});
    alice.pass();
    bob.pass();
    groupCopy()->addSubgroup(std::dynamic_pointer_cast<CXGroup>(copyOf(crew, kCXSubscribedGroupTable)));
    bob.application->save();
    passThatIsTakenBack(bob, kAtTheEnd);
    alice.pass();
    ASSERT_EQ(friends->subgroupUniqueIds().size(), 1u) << log.text();
    passThatIsTakenBack(bob, kAtTheEnd);
    friends->removeSubgroup(crew);
    alice.application->save();
    alice.pass();
    settle();
    EXPECT_TRUE(friends->subgroupUniqueIds().empty()) << log.text();
}

// By then the daemon's scan looks behind the end of the pass, and only the journal knows of the name.
TEST_F(TakenBackPass, ANameThatIsGivenDuringAPassIsSentByTheNextDaemon) {
    bob.pass();
    const CXGroupRef copy = groupCopy();
    rename(alice, friends, "Alice's");
    rename(bob, copy, "Bob's");
    alice.pass();
    bob.pass();
    bool named = false;
    bob.wire->intercept([&](const HttpRequest& request) -> std::optional<HttpResponse> {
        if (request.method == "PUT" && !std::exchange(named, true)) rename(bob, copy, "Third");
        return std::nullopt;
    });
    bob.copyOf(people[0])->setValue(Value("A note"), kCXNoteProperty);
    bob.application->save();
    ASSERT_TRUE(bob.database->deliverExternalChanges());
    bob.wire->intercept({});
    ASSERT_TRUE(named) << log.text();
    bob.start();
    settle();
    EXPECT_EQ(friends->name(), "Third") << log.text();
}

// Bob's version came, and Alice has seen it, though Bob's daemon does not know that.
TEST_F(TakenBackPass, AValueThatTheOtherOneReplacedIsNotBroughtBackByALaterEdit) {
    bob.pass();
    const CXPersonRef copy = bob.copyOf(people[1]);
    CXMutableMultiValue numbers;
    numbers.addValue("1", kCXHomeLabel);
    numbers.addValue("2", kCXWorkLabel);
    copy->setValue(Value("Bob's"), kCXNicknameProperty);
    copy->setValue(numbers, kCXPhoneProperty);
    bob.application->save();
    passThatIsTakenBack(bob);
    alice.pass();
    ASSERT_EQ(people[1]->valueForProperty(kCXNicknameProperty), Value("Bob's")) << log.text();
    people[1]->setValue(Value("Alice's"), kCXNicknameProperty);
    CXMutableMultiValue one;
    const auto both = people[1]->multiValueForProperty(kCXPhoneProperty);
    one.addValue("2", kCXWorkLabel, both->entries()[1].identifier);
    people[1]->setValue(one, kCXPhoneProperty);
    alice.application->save();
    alice.pass();
    copy->setValue(Value("Later"), kCXNoteProperty);
    bob.application->save();
    settle();
    EXPECT_EQ(people[1]->valueForProperty(kCXNicknameProperty), Value("Alice's")) << log.text();
    EXPECT_EQ(people[1]->multiValueForProperty(kCXPhoneProperty)->entries().size(), 1u) << log.text();
    EXPECT_EQ(people[1]->valueForProperty(kCXNoteProperty), Value("Later")) << log.text();
}

TEST_F(TakenBackPass, ANewGroupKeepsTheNameThatItIsGivenDuringTheNextPass) {
    const CXGroupRef crew = alice.group("Crew", {people[1]});
    passThatIsTakenBack(alice, "/AllCXGroup");
    bool renamed = false;
    alice.wire->intercept([&](const HttpRequest& request) -> std::optional<HttpResponse> {
        const bool isTheGroup =
            request.url.encodedPath().find(std::string(cxUUIDPart(crew->uniqueId()))) != std::string::npos;
        if (request.method == "PUT" && isTheGroup && !std::exchange(renamed, true)) rename(alice, crew, "Band");
        return std::nullopt;
    });
    alice.pass();
    alice.wire->intercept({});
    ASSERT_TRUE(renamed) << log.text();
    EXPECT_EQ(crew->name(), "Band") << log.text();
    alice.database->deliverExternalChanges();
    settle();
    EXPECT_EQ(crew->name(), "Band") << log.text();
}

TEST_F(TakenBackPass, ANewGroupThatIsDeletedDuringTheNextPassStaysDeleted) {
    const CXGroupRef crew = alice.group("Crew", {people[1]});
    passThatIsTakenBack(alice, "/AllCXGroup");
    const UniqueId uid = crew->uniqueId();
    bool removed = false;
    alice.wire->intercept([&](const HttpRequest& request) -> std::optional<HttpResponse> {
        const bool isTheGroup = request.url.encodedPath().find(std::string(cxUUIDPart(uid))) != std::string::npos;
        if (request.method == "PUT" && isTheGroup && !std::exchange(removed, true)) remove(alice, crew);
        return std::nullopt;
    });
    alice.pass();
    alice.wire->intercept({});
    ASSERT_TRUE(removed) << log.text();
    alice.database->deliverExternalChanges();
    settle();
    EXPECT_FALSE(alice.application->recordForUniqueId(uid)) << log.text();
    EXPECT_FALSE(std::filesystem::exists(world->file(uid.str())));
}

// Its absence in a database with another subscription is nobody's doing.
TEST_F(TakenBackPass, WhatANewSubscriptionHasNotBroughtYetIsNotDeleted) {
    const CXPersonRef dora = addToAlices("Dora");
    passThatIsTakenBack(bob, "/AllCXGroup");
    for (const CXSubscriptionRef& subscription : bob.application->subscriptions())
        if (subscription->remoteLocation() == RemoteLocation(alice.base)) bob.application->removeRecord(subscription);
    bob.application->save();
    bob.subscribe(alice);
    settle();
    EXPECT_EQ(alice.countPeople(), 4u) << log.text();
    EXPECT_TRUE(isOnTheStore(dora->uniqueId()));
}

// Nothing of it has ever been on the store, and no comparison knows that it was to come.
TEST_F(TakenBackPass, WhatAWriterMakesAndDeletesWhileTheStoreIsAwayNeverComes) {
    bob.network.reachable = false;
    const CXPersonRef dora = addToAlices("Dora");
    const CXGroupRef circle = groupInAlices("Circle");
    circle->addMember(dora);
    bob.application->save();
    bob.pass();
    EXPECT_FALSE(bob.engine->getPendingChanges().empty());
    remove(bob, circle);
    remove(bob, dora);
    bob.start();
    bob.network.reachable = true;
    settle();
    EXPECT_EQ(alice.countPeople(), 3u) << log.text();
    EXPECT_FALSE(isOnTheStore(dora->uniqueId()));
    EXPECT_FALSE(std::filesystem::exists(world->file(cxNormalizedUID(circle->uniqueId()).str())));
}

// Half a group would be taken in, listed by whoever did, and come back when its maker deletes it.
TEST_F(TakenBackPass, ANewGroupAndThoseWhoNameANewContactWaitForTheListOfEverybody) {
    const CXGroupRef circle = groupInAlices("Circle");
    const CXPersonRef dora = addToAlices("Dora");
    const auto copy = std::dynamic_pointer_cast<CXGroup>(copyOf(friends, kCXSubscribedGroupTable));
    copy->addMember(dora);
    bob.application->save();
    std::atomic<bool> fails = true;
    bob.wire->intercept([&](const HttpRequest& request) {
        const bool isList =
            request.method == "PUT" && request.url.encodedPath().find("/AllCXGroup") != std::string::npos;
        return fails && isList ? std::optional(answerOf(503)) : std::nullopt;
    });
    bob.pass();
    const UniqueId shared = cxNormalizedUID(circle->uniqueId());
    EXPECT_FALSE(std::filesystem::exists(world->file(shared.str()))) << log.text();
    const auto before = alice.view();
    alice.pass();
    EXPECT_EQ(alice.view(), before) << log.text();
    fails = false;
    settle();
    EXPECT_TRUE(alice.application->recordForUniqueId(shared)) << log.text();
    EXPECT_TRUE(alice.application->recordForUniqueId(cxNormalizedUID(dora->uniqueId())));
    EXPECT_EQ(friends->memberUniqueIds().size(), 3u);
}

// A file that is gone and a name that is not would be a lost contact, and its owner would write it again.
TEST_F(TakenBackPass, ADeletionWaitsForTheListOfEverybody) {
    const CXPersonRef copy = bob.copyOf(people[1]);
    const CXRecordRef group = copyOf(friends, kCXSubscribedGroupTable);
    bob.application->removeRecord(copy);
    bob.application->removeRecord(group);
    bob.application->save();
    std::atomic<bool> fails = true;
    bob.wire->intercept([&](const HttpRequest& request) {
        const bool isList =
            request.method == "PUT" && request.url.encodedPath().find("/AllCXGroup") != std::string::npos;
        return fails && isList ? std::optional(answerOf(503)) : std::nullopt;
    });
    bob.pass();
    EXPECT_TRUE(isOnTheStore(people[1]->uniqueId())) << log.text();
    EXPECT_TRUE(std::filesystem::exists(world->file(friends->uniqueId().str())));
    const auto before = alice.view();
    alice.pass();
    EXPECT_EQ(alice.view(), before) << log.text();
    fails = false;
    settle();
    EXPECT_FALSE(isOnTheStore(people[1]->uniqueId())) << log.text();
    EXPECT_EQ(alice.countPeople(), 2u);
}

// The list is not written while the note of its new names cannot be stored.
TEST_F(TakenBackPass, ADeletionWaitsForAListThatADiskWithoutSpaceHoldsUp) {
    addToAlices("Dora");
    remove(bob, bob.copyOf(people[1]));
    passThatIsTakenBack(bob, "/People/");
    EXPECT_TRUE(isOnTheStore(people[1]->uniqueId())) << log.text();
    settle();
    EXPECT_FALSE(isOnTheStore(people[1]->uniqueId())) << log.text();
    EXPECT_EQ(alice.countPeople(), 3u);
}

// The pass had written file and name; the other one took the contact in, and took it away.
TEST_F(TakenBackPass, AContactThatSomebodyElseDeletesBehindItStaysDeleted) {
    for (Participant* maker : {&alice, &bob}) {
        SCOPED_TRACE(maker->name);
        Participant& other = maker == &alice ? bob : alice;
        const UniqueId dora = cxNormalizedUID((maker == &alice ? alice.add("Dora") : addToAlices("Emil"))->uniqueId());
        passThatIsTakenBack(*maker, "/AllCXGroup");
        ASSERT_TRUE(isOnTheStore(dora)) << log.text();
        other.pass();
        const CXRecordRef theirs = other.application->recordForUniqueId(
            maker == &alice ? cxUIDWithTableName(dora, kCXSubscribedPersonTable) : dora);
        ASSERT_TRUE(theirs) << log.text();
        remove(other, theirs);
        other.pass();
        ASSERT_FALSE(isOnTheStore(dora)) << log.text();
        settle();
        EXPECT_FALSE(isOnTheStore(dora)) << log.text();
        EXPECT_EQ(alice.countPeople(), 3u);
    }
}

// The contact was tried before, and could not be written.
TEST_F(TakenBackPass, AContactThatHasWaitedAndIsDeletedBehindItStaysDeleted) {
    const UniqueId dora = cxNormalizedUID(addToAlices("Dora")->uniqueId());
    bob.wire->intercept([](const HttpRequest& request) {
        return request.method == "PUT" ? std::optional(answerOf(503)) : std::nullopt;
    });
    bob.pass();
    ASSERT_FALSE(isOnTheStore(dora));
    passThatIsTakenBack(bob, "/AllCXGroup");
    ASSERT_TRUE(isOnTheStore(dora)) << log.text();
    alice.pass();
    const CXRecordRef hers = alice.application->recordForUniqueId(dora);
    ASSERT_TRUE(hers) << log.text();
    remove(alice, hers);
    alice.pass();
    settle();
    EXPECT_FALSE(isOnTheStore(dora)) << log.text();
    EXPECT_EQ(alice.countPeople(), 3u);
}

TEST_F(TakenBackPass, AGroupThatSomebodyElseDeletesBehindItStaysDeleted) {
    for (Participant* maker : {&alice, &bob}) {
        SCOPED_TRACE(maker->name);
        Participant& other = maker == &alice ? bob : alice;
        const UniqueId crew =
            cxNormalizedUID((maker == &alice ? alice.group("Crew", {people[1]}) : groupInAlices("Circle"))->uniqueId());
        passThatIsTakenBack(*maker, kAtTheEnd);
        ASSERT_TRUE(std::filesystem::exists(world->file(crew.str()))) << log.text();
        other.pass();
        const CXRecordRef theirs = other.application->recordForUniqueId(
            maker == &alice ? cxUIDWithTableName(crew, kCXSubscribedGroupTable) : crew);
        ASSERT_TRUE(theirs) << log.text();
        remove(other, theirs);
        other.pass();
        settle();
        EXPECT_FALSE(std::filesystem::exists(world->file(crew.str()))) << log.text();
        EXPECT_FALSE(alice.application->recordForUniqueId(crew));
    }
}

// Until it is known whether it was deleted, it is not written again.
TEST_F(TakenBackPass, AContactThatWasDeletedBehindItIsNotWrittenWhileTheTreeCannotBeRead) {
    const UniqueId dora = cxNormalizedUID(addToAlices("Dora")->uniqueId());
    passThatIsTakenBack(bob, "/AllCXGroup");
    alice.pass();
    remove(alice, alice.application->recordForUniqueId(dora));
    alice.pass();
    bool listed = false; // then the store is well again
    bob.wire->intercept([&](const HttpRequest& request) {
        const bool isListing = request.method == "PROPFIND" || request.method == "REPORT";
        listed |= request.method == "PUT";
        return isListing && !listed ? std::optional(answerOf(503)) : std::nullopt;
    });
    bob.pass();
    bob.wire->intercept({});
    EXPECT_FALSE(isOnTheStore(dora)) << log.text();
    settle();
    EXPECT_FALSE(isOnTheStore(dora)) << log.text();
    EXPECT_EQ(alice.countPeople(), 3u);
}

// Half a contact is no contact that was deleted.
TEST_F(TakenBackPass, AContactThatItsOwnerHasTakenForALeftoverIsWrittenAgain) {
    const UniqueId dora = cxNormalizedUID(addToAlices("Dora")->uniqueId());
    passThatIsTakenBack(bob, "/AllCXGroup", 503);
    ASSERT_TRUE(isOnTheStore(dora)) << log.text();
    alice.pass();
    alice.clock.ahead = bob.clock.ahead = 8.0 * 86400;
    alice.pass();
    alice.pass();
    ASSERT_FALSE(isOnTheStore(dora)) << log.text();
    settle();
    EXPECT_TRUE(isOnTheStore(dora)) << log.text();
    EXPECT_EQ(alice.countPeople(), 4u);
}

// Its file had come all the same, and the answer got lost.
TEST_F(TakenBackPass, ANewGroupThatItsOwnerDeletesWithinTheWeekStaysDeleted) {
    const UniqueId shared = cxNormalizedUID(groupInAlices("Circle")->uniqueId());
    refuseFileOf(shared);
    bob.pass();
    bob.wire->intercept({});
    rewrite(world->file(shared.str()),
            PropertyList::toXML(Dictionary{
                {kMemberUIDState, Array()}, {kSubgroupUIDState, Array()}, {kCXGroupNameProperty, "Circle"}}));
    alice.pass();
    const CXRecordRef taken = alice.application->recordForUniqueId(shared);
    ASSERT_TRUE(taken) << log.text();
    remove(alice, taken);
    settle();
    EXPECT_FALSE(alice.application->recordForUniqueId(shared)) << log.text();
    EXPECT_FALSE(std::filesystem::exists(world->file(shared.str())));
}

// Its name stood in the list for a week, its file never came, and the owner's daemon has taken the name out.
TEST_F(TakenBackPass, ANewContactWhoseNameItsOwnerHasTakenForALeftoverIsWrittenAgain) {
    const CXPersonRef dora = addToAlices("Dora");
    const auto copy = std::dynamic_pointer_cast<CXGroup>(copyOf(friends, kCXSubscribedGroupTable));
    copy->addMember(dora);
    bob.application->save();
    const UniqueId shared = cxNormalizedUID(dora->uniqueId());
    leaveHalf(shared);
    settle();
    EXPECT_TRUE(isOnTheStore(shared)) << log.text();
    EXPECT_EQ(alice.countPeople(), 4u);
    EXPECT_EQ(friends->memberUniqueIds().size(), 3u);
    EXPECT_TRUE(bob.application->recordForUniqueId(dora->uniqueId()));
}

// The name goes while the pass that is to write the file is under way.
TEST_F(TakenBackPass, ANewContactWhoseNameIsTakenAwayBesideItsWriteIsWrittenAgain) {
    const UniqueId shared = cxNormalizedUID(addToAlices("Dora")->uniqueId());
    refuseFileOf(shared);
    bob.pass();
    alice.pass();
    alice.clock.ahead = bob.clock.ahead = 8.0 * 86400;
    bool taken = false;
    bob.wire->intercept([&](const HttpRequest& request) -> std::optional<HttpResponse> {
        const bool isFile = request.url.encodedPath().find(shared.str().substr(0, 36)) != std::string::npos;
        if (isFile && !std::exchange(taken, true)) {
            Dictionary list = contentOf(world->file("AllCXGroup")).mutableCopy();
            list.arrayFor(kMemberUIDState).removeAll(shared);
            rewrite(world->file("AllCXGroup"), PropertyList::toXML(list));
        }
        return std::nullopt;
    });
    bob.pass();
    bob.wire->intercept({});
    ASSERT_TRUE(taken);
    settle();
    EXPECT_TRUE(isOnTheStore(shared)) << log.text();
    EXPECT_EQ(alice.countPeople(), 4u);
}

// Its file had come all the same, and the answer got lost.
TEST_F(TakenBackPass, ANewContactThatItsOwnerDeletesStaysDeleted) {
    for (const bool isRefusedForLong : {false, true}) {
        const CXPersonRef dora = addToAlices("Dora");
        const UniqueId shared = cxNormalizedUID(dora->uniqueId());
        refuseFileOf(shared);
        bob.pass();
        if (!isRefusedForLong) bob.wire->intercept({});
        rewrite(fileOf(shared), PropertyList::toXML(Dictionary{{kCXFirstNameProperty, "Dora"}}));
        if (isRefusedForLong) {
            dora->setValue(Value("met in Lyon"), kCXNoteProperty);
            bob.application->save();
            bob.pass(); // sees the file, and cannot write it
        }
        bob.wire->intercept({});
        alice.pass();
        const CXRecordRef taken = alice.application->recordForUniqueId(shared);
        ASSERT_TRUE(taken) << log.text();
        if (isRefusedForLong) bob.clock.ahead = alice.clock.ahead = 8.0 * 86400;
        remove(alice, taken);
        alice.pass();
        settle();
        EXPECT_FALSE(alice.application->recordForUniqueId(shared)) << isRefusedForLong << log.text();
        EXPECT_FALSE(isOnTheStore(shared)) << isRefusedForLong;
    }
}

// The file came with the second pass, and the contact was there for a week.
TEST_F(TakenBackPass, AContactWhoseFileCameLaterAndThatItsOwnerDeletesAfterAWeekStaysDeleted) {
    const UniqueId shared = cxNormalizedUID(addToAlices("Dora")->uniqueId());
    refuseFileOf(shared);
    bob.pass();
    bob.wire->intercept({});
    bob.pass();
    ASSERT_TRUE(isOnTheStore(shared)) << log.text();
    alice.pass();
    alice.clock.ahead = bob.clock.ahead = 8.0 * 86400;
    remove(alice, alice.application->recordForUniqueId(shared));
    alice.pass();
    settle();
    EXPECT_FALSE(alice.application->recordForUniqueId(shared)) << log.text();
    EXPECT_FALSE(isOnTheStore(shared));
}

TEST_F(TakenBackPass, ANewGroupWhoseNameItsOwnerHasTakenForALeftoverIsWrittenAgain) {
    const CXGroupRef circle = groupInAlices("Circle");
    circle->addMember(bob.copyOf(people[1]));
    const auto outer = std::dynamic_pointer_cast<CXGroup>(copyOf(friends, kCXSubscribedGroupTable));
    outer->addSubgroup(circle);
    bob.application->save();
    const UniqueId shared = cxNormalizedUID(circle->uniqueId());
    leaveHalf(shared);
    settle();
    const auto here = std::dynamic_pointer_cast<CXGroup>(alice.application->recordForUniqueId(shared));
    ASSERT_TRUE(here) << log.text();
    EXPECT_EQ(here->name(), "Circle");
    EXPECT_EQ(here->memberUniqueIds(), std::vector{people[1]->uniqueId()});
    EXPECT_EQ(friends->subgroupUniqueIds(), std::vector{shared});
}

} // namespace rolvane::test
