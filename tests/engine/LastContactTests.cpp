// The last one leaves: a tree that is emptied contact by contact, and group by group, is empty everywhere.

#include "TwoUsers.h"
#include "contacts/records/CXSubscription.h"
#include "engine/memory/EngineState.h"

namespace rolvane::test {

class LastContact : public TwoUsers {
protected:
    // Who writes goes first.
    static void settle(Participant& first, Participant& second) {
        for (int i = 0; i < 2; ++i) {
            first.pass();
            second.pass();
        }
    }
    static void remove(Participant& user, const UniqueId& uid) {
        const CXRecordRef record = user.application->recordForUniqueId(uid);
        ASSERT_TRUE(record) << user.name << " " << uid.str();
        user.application->removeRecord(record);
        user.application->save();
    }
    static UniqueId copyOf(const UniqueId& uid) {
        return cxUIDWithTableName(uid,
                                  uid.endsWith(kCXGroupTable) ? kCXSubscribedGroupTable : kCXSubscribedPersonTable);
    }
    std::vector<UniqueId> identifiers() const {
        std::vector<UniqueId> all;
        for (const CXPersonRef& person : people) all.push_back(person->uniqueId());
        return all;
    }
    size_t filesOfContacts() {
        size_t count = 0;
        for (const auto& entry : std::filesystem::recursive_directory_iterator(world->file("People")))
            count += entry.is_regular_file();
        return count;
    }
    void expectNobodyAnywhere() {
        EXPECT_EQ(alice.countPeople(), 0u) << log.text();
        EXPECT_EQ(bob.countPeople(alice.base), 0u) << log.text();
        EXPECT_EQ(filesOfContacts(), 0u);
        EXPECT_EQ(copies(), alice.view());
        for (Participant* each : {&alice, &bob}) {
            EXPECT_TRUE(each->engine->getPendingChanges().empty()) << each->name;
            expectQuietPass(*each);
        }
        EXPECT_FALSE(log.mentions("published again")) << log.text();
        EXPECT_FALSE(log.mentions("left alone")) << log.text();
        EXPECT_TRUE(bob.alert.told.empty());
    }
    // Somebody comes after everybody has gone.
    void expectThatTheTreeStillWorks() {
        alice.add("Zoe");
        settle(alice, bob);
        EXPECT_EQ(bob.countPeople(alice.base), 1u) << log.text();
        EXPECT_EQ(copies(), alice.view());
    }
};

TEST_F(LastContact, ThatTheOwnerDeletesLeavesTheStoreAndTheReader) {
    settle(alice, bob);
    for (const UniqueId& each : identifiers()) {
        remove(alice, each);
        settle(alice, bob);
        EXPECT_EQ(copies(), alice.view()) << log.text();
    }
    expectNobodyAnywhere();
    expectThatTheTreeStillWorks();
}

// Its file is gone, and its name waits. For its owner that is no lost tree, whose groups would all be made anew.
TEST_F(LastContact, WhoseNameAWriterCouldNotTakeOutYetLeavesWithAGroupThatIsDeletedMeanwhile) {
    settle(alice, bob);
    for (size_t i = 0; i < 2; ++i) remove(bob, copyOf(people[i]->uniqueId()));
    settle(bob, alice);
    remove(bob, copyOf(people[2]->uniqueId()));
    bob.wire->intercept([](const HttpRequest& request) -> std::optional<HttpResponse> {
        if (request.method != "PUT" || !request.url.encodedPath().ends_with("AllCXGroup")) return std::nullopt;
        HttpResponse failed;
        failed.status = 500;
        return failed;
    });
    bob.pass();
    bob.wire->intercept({});
    ASSERT_FALSE(bob.engine->getPendingChanges().empty()) << log.text();
    alice.pass();
    remove(bob, copyOf(friends->uniqueId()));
    settle(bob, alice);
    settle(bob, alice);
    EXPECT_FALSE(alice.application->recordForUniqueId(friends->uniqueId())) << log.text();
    expectNobodyAnywhere();
    expectThatTheTreeStillWorks();
}

TEST_F(LastContact, ThatAWriterDeletesLeavesTheStoreAndTheOwner) {
    settle(alice, bob);
    for (const UniqueId& each : identifiers()) {
        remove(bob, copyOf(each));
        settle(bob, alice);
        EXPECT_EQ(copies(), alice.view()) << log.text();
    }
    expectNobodyAnywhere();
    expectThatTheTreeStillWorks();
}

TEST_F(LastContact, OfAllThatAreDeletedInOneSaveLeavesToo) {
    settle(alice, bob);
    for (const UniqueId& each : identifiers())
        alice.application->removeRecord(alice.application->recordForUniqueId(each));
    alice.application->save();
    settle(alice, bob);
    expectNobodyAnywhere();
    expectThatTheTreeStillWorks();
}

TEST_F(LastContact, AndTheLastGroupLeaveInEitherOrder) {
    settle(alice, bob);
    const UniqueId group = friends->uniqueId();
    remove(alice, people[0]->uniqueId());
    remove(alice, people[1]->uniqueId());
    remove(alice, group);
    settle(alice, bob);
    EXPECT_EQ(copies(), alice.view()) << log.text();
    remove(alice, people[2]->uniqueId());
    settle(alice, bob);
    expectNobodyAnywhere();

    const UniqueId second = alice.group("Second", {alice.add("Zoe")})->uniqueId();
    settle(alice, bob);
    ASSERT_EQ(bob.countPeople(alice.base), 1u) << log.text();
    for (const CXListing& each : alice.application->listPeople(RemoteLocation())) remove(alice, each.uniqueId);
    settle(alice, bob);
    expectNobodyAnywhere();
    remove(bob, copyOf(second)); // which is empty, and the last of all
    settle(bob, alice);
    EXPECT_TRUE(alice.application->listGroups(RemoteLocation()).empty()) << log.text();
    expectNobodyAnywhere();
    expectThatTheTreeStillWorks();
}

// Where others may write, a deletion takes the name first. An older program took the file, and somebody may look in
// between.
TEST_F(LastContact, WhoseFileIsGoneAndWhoseNameIsListedYetIsWaitedFor) {
    for (const UniqueId& each : {people[0]->uniqueId(), people[1]->uniqueId()}) remove(alice, each);
    settle(alice, bob);
    ASSERT_EQ(bob.countPeople(alice.base), 1u) << log.text();
    remove(alice, people[2]->uniqueId());
    alice.wire->intercept([](const HttpRequest& request) {
        return request.method == "PUT" ? std::optional(answerOf(503)) : std::nullopt;
    });
    alice.pass();
    ASSERT_EQ(filesOfContacts(), 1u) << log.text();
    ASSERT_TRUE(std::filesystem::remove(fileOf(people[2])));
    bob.pass();
    EXPECT_EQ(bob.countPeople(alice.base), 1u) << "its list says that it is there\n" << log.text();
    alice.wire->intercept({});
    log.clear();
    for (int i = 0; i < 2; ++i) settle(alice, bob);
    EXPECT_EQ(alice.countPeople(), 0u);
    EXPECT_EQ(bob.countPeople(alice.base), 0u) << log.text();
    expectThatTheTreeStillWorks();
}

// -- a group that is published by itself

class LastContactOfAPublishedGroup : public LastContact {
protected:
    LastContactOfAPublishedGroup() {
        CXMutableMultiValue locations, none;
        locations.addValue(alice.base, kCXPublishLabel);
        CXRolvane& database = *alice.application;
        database.allGroup()->setValue(none, kCXRemoteLocationProperty);
        friends->setValue(locations, kCXRemoteLocationProperty);
        database.addRecord(CXSubscription::create(RemoteLocation("published-groups"), false));
        database.save();
        // Published as if nothing had been before.
        std::filesystem::remove_all(world->file());
        alice.preferences.remove(kDaemonDomain, kCXDConduitData);
        alice.preferences.synchronize(kDaemonDomain);
        alice.start();
        // Bob's copies have a list of everybody, which he tells to Alice's tree.
        for (int i = 0; i < 2; ++i) settle(alice, bob);
    }
    size_t membersAtBobs() {
        const auto group =
            std::dynamic_pointer_cast<CXGroup>(bob.application->recordForUniqueId(copyOf(friends->uniqueId())));
        return group ? group->memberCount() : SIZE_MAX;
    }
};

TEST_F(LastContactOfAPublishedGroup, LeavesTheReadersGroup) {
    ASSERT_EQ(membersAtBobs(), 2u) << log.text();
    for (const CXPersonRef& member : friends->members()) {
        friends->removeMember(member);
        alice.application->save();
        settle(alice, bob);
        EXPECT_EQ(membersAtBobs(), friends->memberCount()) << log.text();
    }
    EXPECT_EQ(alice.countPeople(), 3u);
    friends->addMember(people[1]);
    alice.application->save();
    settle(alice, bob);
    EXPECT_EQ(membersAtBobs(), 1u) << log.text();
}

TEST_F(LastContactOfAPublishedGroup, ThatIsDeletedLeavesTheReadersGroup) {
    for (const UniqueId& member : friends->memberUniqueIds()) {
        remove(alice, member);
        settle(alice, bob);
        EXPECT_FALSE(alice.application->recordForUniqueId(member)) << log.text();
        EXPECT_EQ(membersAtBobs(), friends->memberCount()) << log.text();
    }
    EXPECT_EQ(membersAtBobs(), 0u);
    EXPECT_EQ(alice.countPeople(), 1u);
}

TEST_F(LastContactOfAPublishedGroup, ThatAWriterDeletesLeavesTheOwner) {
    for (const UniqueId& member : friends->memberUniqueIds()) {
        remove(bob, copyOf(member));
        settle(bob, alice);
        EXPECT_FALSE(alice.application->recordForUniqueId(member)) << log.text();
        EXPECT_EQ(membersAtBobs(), friends->memberCount()) << log.text();
    }
    EXPECT_EQ(membersAtBobs(), 0u);
    EXPECT_EQ(alice.countPeople(), 1u) << "who was never published";
}

} // namespace rolvane::test
