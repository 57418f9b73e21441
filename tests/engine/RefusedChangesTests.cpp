// The owner's own store refuses the owner's changes: for lack of rights in the whole tree, or in a part of it.

#include "engine/queue/RefusedChanges.h"

#include "engine/memory/EngineState.h"
#include "model/PayloadKeys.h"

#include "TwoUsers.h"

#include <gtest/gtest.h>

namespace rolvane::test {
namespace {

constexpr const char* kWrites = "'PUT', 'DELETE', 'MKCOL', 'MOVE', 'COPY', 'PROPPATCH', 'ACL'";

// Between two looks somebody may have listed the contact that one of them found in no list.
TEST(RefusedChanges, WhatTheNextLookFindsAgainIsLeftToNoScan) {
    auto removal = std::make_shared<CXDChangeRecord>(CXDSyncSourceCX, CXDDeleteRecord, kSelf, UniqueId("a:CXPerson"),
                                                     std::nullopt);
    removal->setAppliesToSources(CXDSyncSourceVaultra);
    const Date now{1'800'000'000};
    for (const bool isFoundAgain : {true, false}) {
        const auto findsAgain = [&](const CXDChangeRecord&) { return isFoundAgain; };
        Dictionary data;
        noteRefusedChanges(data, {removal}, {removal}, findsAgain, now);
        ASSERT_TRUE(hasRefusedChanges(data));
        EXPECT_EQ(data[kConduitCX].dictionary()[kUnsettledPeople].dictionary().empty(), isFoundAgain);
        data[kConduitCX].dictionary().remove(kUnsettledPeople);
        CXDChangeRecords gathered{removal};
        holdBackRefusedChanges(data, gathered, findsAgain, now.addingSeconds(1));
        EXPECT_TRUE(gathered.empty());
        EXPECT_EQ(data[kConduitCX].dictionary()[kUnsettledPeople].dictionary().empty(), isFoundAgain);
    }
}

// An httpd that refuses writes in Alice's tree (403) while there is a file that says so.
class RefusingStore {
public:
    RefusingStore() : world(options()) { std::filesystem::permissions(switches.path(), std::filesystem::perms(0755)); }
    // "everything", "contacts", "groups", or the name of one file.
    void refuse(const std::string& what) const { std::ofstream(switches.path() + "/" + what) << "x"; }
    void refuseNothing() const {
        for (const auto& file : std::filesystem::directory_iterator(switches.path())) std::filesystem::remove(file);
    }

private:
    PrivateStoreOptions options() const {
        PrivateStoreOptions made;
        for (const auto& [what, path] : std::map<std::string, std::string>{
                 {"everything", "/"}, {"contacts", "/People/"}, {"groups", "CXGroup$"}}) {
            made.extraConfiguration.push_back("<LocationMatch \"^/dav/alice/.*" + path + "\">");
            made.extraConfiguration.push_back("<If \"-f '" + switches.path() + "/" + what +
                                              "' && %{REQUEST_METHOD} in {" + kWrites + "}\">");
            made.extraConfiguration.push_back("Require all denied");
            made.extraConfiguration.push_back("</If>");
            made.extraConfiguration.push_back("</LocationMatch>");
        }
        made.extraConfiguration.push_back("<LocationMatch \"^/dav/alice/.*/(?<FILE>[^/]+)$\">");
        made.extraConfiguration.push_back("<If \"-f '" + switches.path() +
                                          "/%{env:MATCH_FILE}' && %{REQUEST_METHOD} in {" + kWrites + "}\">");
        made.extraConfiguration.push_back("Require all denied");
        made.extraConfiguration.push_back("</If>");
        made.extraConfiguration.push_back("</LocationMatch>");
        return made;
    }
    TempDirectory switches;

public:
    StoreWorld world;
};

// Alice has published three people and a group; Bob subscribes and has them.
class RefusedByOwnStore : public testing::TestWithParam<bool> {
protected:
    static void SetUpTestSuite() { store = new RefusingStore; }
    static void TearDownTestSuite() {
        delete store;
        store = nullptr;
    }
    RefusedByOwnStore() {
        store->refuseNothing();
        std::filesystem::remove_all(store->world.file());
        people = {alice.add("Ada"), alice.add("Ben"), alice.add("Cleo")};
        friends = alice.group("Friends", {people[0], people[2]});
        share(GetParam() ? "bob" : "");
        alice.publish();
        alice.pass();
        bob.subscribe(alice);
        settle();
    }
    void share(const std::string& writer) {
        CXMutableMultiValue users;
        users.addValue("bob", "bob");
        alice.application->allGroup()->setValue(users, kCXReadSharingACLProperty);
        if (!writer.empty()) alice.application->allGroup()->setValue(users, kCXReadWriteSharingACLProperty);
        alice.application->save();
    }
    void settle() {
        for (int i = 0; i < 3; ++i) {
            alice.pass();
            bob.pass();
        }
        ASSERT_EQ(bob.view(alice.base), alice.view()) << log.text();
    }
    // Passes of both while the store refuses, over hours.
    void passHours() {
        const auto before = alice.view();
        for (int i = 0; i < 12; ++i) {
            alice.clock.ahead += 600;
            alice.pass();
            alice.loop.runOnce(0); // what the pass has scheduled
            bob.pass();
            ASSERT_EQ(alice.view(), before) << "after " << i << " passes\n" << log.text();
        }
    }
    void afterTheRefusal() {
        store->refuseNothing();
        for (int i = 0; i < 3; ++i) {
            alice.clock.ahead += 3600;
            alice.pass();
        }
    }
    void expectEverythingArrived(const std::map<std::string, std::string>& expected) {
        EXPECT_EQ(alice.view(), expected) << log.text();
        settle();
        EXPECT_EQ(bob.view(alice.base), expected) << log.text();
        Participant late{store->world, "bob"};
        late.subscribe(alice);
        late.pass();
        EXPECT_EQ(late.view(alice.base), expected) << "a new subscriber\n" << log.text();
        EXPECT_TRUE(alice.engine->getPendingChanges().empty());
        EXPECT_FALSE(hasRefusedChanges(alice.engine->conduitData()));
        EXPECT_EQ(refusedNotes(), 0u);
        alice.wire->clear();
        alice.pass();
        EXPECT_EQ(alice.writes(), 0u) << "nothing is left\n" << alice.wire->text();
    }
    size_t refusedNotes() const {
        size_t count = 0;
        for (const Value& note : alice.preferences.get(kDaemonDomain, kCXDRefusedChanges).array())
            count += note.dictionary()[kRefusedUser] == Value(kSelf);
        return count;
    }
    size_t attempts() const {
        size_t count = 0;
        for (const auto& exchange : alice.wire->exchanges())
            count += exchange.method == "PUT" && exchange.status == 403 && !exchange.path.ends_with("dateFile");
        return count;
    }
    void rename(const CXPersonRef& person, const std::string& first) {
        person->setValue(Value(first), kCXFirstNameProperty);
        alice.application->save();
    }
    // One of everything that a person may change.
    void changeEverything() {
        for (const char* name : {"Dora", "Emil", "Fritz"}) people.push_back(alice.add(name));
        rename(people[0], "Adelheid");
        friends->setValue(Value("Best friends"), kCXGroupNameProperty);
        friends->addMember(people[3]);
        friends->removeMember(people[2]);
        alice.group("Family", {people[1], people[4]});
        alice.application->removeRecord(people[1]);
        alice.application->save();
    }

    static inline RefusingStore* store = nullptr;
    CapturingLog log;
    Participant alice{store->world, "alice"}, bob{store->world, "bob"};
    std::vector<CXPersonRef> people;
    CXGroupRef friends;
};

INSTANTIATE_TEST_SUITE_P(WithAndWithoutAWriter, RefusedByOwnStore, testing::Bool(),
                         [](const auto& writer) { return writer.param ? "AWriterIsListed" : "NobodyElseMayWrite"; });

TEST_P(RefusedByOwnStore, NewContactsStayAndArriveWhenTheRefusalHasEnded) {
    store->refuse("everything");
    for (const char* name : {"Dora", "Emil", "Fritz"}) people.push_back(alice.add(name));
    const auto saved = alice.view();
    alice.pass();
    EXPECT_EQ(alice.view(), saved) << log.text();
    EXPECT_EQ(alice.countPeople(), 6u);
    EXPECT_EQ(refusedNotes(), 1u);
    passHours();
    EXPECT_EQ(refusedNotes(), 1u) << "one note, however often it was tried";
    afterTheRefusal();
    expectEverythingArrived(saved);
}

TEST_P(RefusedByOwnStore, AnEditStaysAndArrives) {
    store->refuse("everything");
    rename(people[0], "Adelheid");
    const auto saved = alice.view();
    passHours();
    afterTheRefusal();
    expectEverythingArrived(saved);
}

TEST_P(RefusedByOwnStore, DeletionsStayDeletedAndArrive) {
    store->refuse("everything");
    alice.application->removeRecord(people[0]);
    alice.application->removeRecord(friends);
    alice.application->save();
    const auto saved = alice.view();
    passHours();
    afterTheRefusal();
    expectEverythingArrived(saved);
}

TEST_P(RefusedByOwnStore, EveryKindOfChangeStaysAndArrivesWithWhatIsEditedMeanwhile) {
    store->refuse("everything");
    changeEverything();
    passHours();
    rename(people[0], "Adele");
    people.push_back(alice.add("Gustav"));
    passHours();
    alice.application->removeRecord(people[3]);
    alice.application->save();
    const auto saved = alice.view();
    passHours();
    afterTheRefusal();
    expectEverythingArrived(saved);
}

TEST_P(RefusedByOwnStore, WhereOnlyContactsAreRefusedNothingIsLost) {
    store->refuse("contacts");
    changeEverything();
    const auto saved = alice.view();
    passHours();
    afterTheRefusal();
    expectEverythingArrived(saved);
}

TEST_P(RefusedByOwnStore, WhereOnlyGroupsAreRefusedNothingIsLost) {
    store->refuse("groups");
    changeEverything();
    const auto saved = alice.view();
    passHours();
    afterTheRefusal();
    expectEverythingArrived(saved);
}

// The list names the only contact, whose file the store has never had. Taken for a tree that has lost its contacts, it
// would be published again, and keep the name.
TEST_P(RefusedByOwnStore, TheOnlyContactThatIsRefusedAndDeletedLeavesNoName) {
    for (const CXPersonRef& person : people) alice.application->removeRecord(person);
    alice.application->save();
    settle();
    store->refuse("contacts");
    const CXPersonRef dora = alice.add("Dora");
    friends->addMember(dora);
    alice.application->save();
    alice.pass();
    alice.application->removeRecord(dora);
    alice.application->save();
    const auto saved = alice.view();
    store->refuseNothing();
    alice.pass(); // while the refused change rests
    alice.loop.runOnce(0);
    afterTheRefusal();
    expectEverythingArrived(saved);
    for (const std::string& list : {std::string("AllCXGroup"), cxNormalizedUID(friends->uniqueId()).str()}) {
        int code = 0;
        const auto state = alice.manager.dictionaryAtURL(
            alice.manager.account().baseLocationFor(UserName("alice")).cxURLByAppendingComponent(list), false, &code);
        ASSERT_TRUE(state) << list << " " << code;
        EXPECT_FALSE((*state)[kMemberUIDState].array().containsString(dora->uniqueId().str())) << list;
    }
}

TEST_P(RefusedByOwnStore, ARestartInBetweenForgetsNothing) {
    store->refuse("everything");
    changeEverything();
    const auto saved = alice.view();
    alice.pass();
    alice.start();
    passHours();
    alice.start();
    afterTheRefusal();
    expectEverythingArrived(saved);
}

TEST_P(RefusedByOwnStore, AttemptsGetRarer) {
    store->refuse("everything");
    rename(people[0], "Adelheid");
    alice.pass();
    EXPECT_GE(attempts(), 1u);
    alice.wire->clear();
    for (int i = 0; i < 5; ++i) alice.pass(); // within the first minute
    EXPECT_EQ(attempts(), 0u) << alice.wire->text();
    std::vector<int> passesThatTry(2);
    for (int& tries : passesThatTry)
        for (int minute = 0; minute < 60; ++minute) {
            alice.clock.ahead += 60;
            alice.wire->clear();
            alice.pass();
            tries += attempts() > 0;
        }
    EXPECT_EQ(passesThatTry, (std::vector<int>{5, 2})) << "after 1, 2, 4, 8, 16 and then every 30 minutes";
}

// The file of the group comes behind those of the contacts, and a contact that is refused takes it along.
TEST_P(RefusedByOwnStore, OneFileThatMayNotBeWrittenKeepsNothingElseWaiting) {
    const std::string name = people[0]->uniqueId().str();
    store->refuse(name);
    changeEverything();
    const auto saved = alice.view();
    for (int i = 0; i < 4; ++i) {
        alice.clock.ahead += 1800;
        alice.pass();
        bob.pass();
    }
    auto expected = saved;
    expected["person " + name] = bob.view(alice.base)["person " + name];
    EXPECT_NE(expected, saved) << "that one is refused";
    EXPECT_EQ(bob.view(alice.base), expected) << log.text();
    EXPECT_EQ(alice.view(), saved) << log.text();
    afterTheRefusal();
    expectEverythingArrived(saved);
}

} // namespace
} // namespace rolvane::test
