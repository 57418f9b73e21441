// Two people who change one contact at once.

#include "TwoUsers.h"
#include "Writes.h"
#include "foundation/CXException.h"
#include "foundation/Sqlite.h"

#include <cstdlib>

namespace rolvane::test {

class TwoEditors : public TwoUsers {
protected:
    TwoEditors() {
        bob.pass();
        alice.pass();
    }
    CXPersonRef person(Participant& user, size_t i = 0) { return &user == &alice ? people[i] : user.copyOf(people[i]); }
    void edit(Participant& user, const char* property, const Value& value, size_t i = 0) {
        const CXPersonRef who = person(user, i);
        ASSERT_TRUE(who);
        who->setValue(value, property);
        user.application->save();
    }
    static void offline(Participant& user, bool is) { user.network.reachable = !is; }
    Value valueOf(Participant& user, const char* property) { return person(user)->valueForProperty(property); }
    void settle() {
        for (Participant* each : {&alice, &bob, &alice, &bob}) each->pass();
    }
    void expectEverywhere(const char* property, const Value& value) {
        EXPECT_EQ(valueOf(alice, property), value) << log.text();
        EXPECT_EQ(valueOf(bob, property), value) << log.text();
        EXPECT_EQ(contentOf(fileOf(people[0]))[property], value) << log.text();
    }
    void expectEqualAndQuiet() {
        EXPECT_EQ(copies(), alice.view()) << log.text();
        for (Participant* each : {&alice, &bob}) {
            EXPECT_TRUE(each->database->editedSinceCommon().empty()) << each->name;
            EXPECT_TRUE(each->engine->getPendingChanges().empty()) << each->name;
            expectQuietPass(*each);
        }
    }
    size_t conflicts() { return alice.database->conflicts().size() + bob.database->conflicts().size(); }
};

TEST_F(TwoEditors, AWritersChangeAndOneThatTheOwnerMadeOffLineAreBothKept) {
    edit(bob, kCXOrganizationProperty, "Engine");
    bob.pass();
    offline(alice, true);
    edit(alice, kCXNicknameProperty, "Countess");
    alice.pass();
    EXPECT_EQ(valueOf(alice, kCXOrganizationProperty), Value());
    offline(alice, false);
    settle();
    expectEverywhere(kCXOrganizationProperty, "Engine");
    expectEverywhere(kCXNicknameProperty, "Countess");
    EXPECT_EQ(conflicts(), 0u);
    expectEqualAndQuiet();
}

TEST_F(TwoEditors, ChangesThatBothMadeOffLineAreKeptWhoeverSendsFirst) {
    for (Participant* first : {&alice, &bob}) {
        Participant* second = first == &alice ? &bob : &alice;
        offline(alice, true);
        offline(bob, true);
        edit(alice, kCXNicknameProperty, "N" + first->name);
        edit(bob, kCXOrganizationProperty, "O" + first->name);
        alice.pass();
        bob.pass();
        offline(*first, false);
        first->pass();
        offline(*second, false);
        second->pass();
        settle();
        expectEverywhere(kCXNicknameProperty, "N" + first->name);
        expectEverywhere(kCXOrganizationProperty, "O" + first->name);
        expectEqualAndQuiet();
    }
}

TEST_F(TwoEditors, WhatASaveSendsAtOnceIsMergedWithWhatLiesThere) {
    edit(bob, kCXOrganizationProperty, "Engine");
    bob.pass();
    edit(alice, kCXNicknameProperty, "Countess");
    auto change = std::make_shared<CXDChangeRecord>(CXDSyncSourceCX, CXDUpdateRecord, kSelf, people[0]->uniqueId(),
                                                    std::nullopt, people[0]->dictionaryRepresentation());
    change->setAppliesToSources(CXDSyncSourceVaultra);
    alice.engine->applyChangeRecords({change}, true);
    EXPECT_EQ(valueOf(alice, kCXOrganizationProperty), Value("Engine")) << "taken in by the same pass";
    settle();
    expectEverywhere(kCXNicknameProperty, "Countess");
    expectEverywhere(kCXOrganizationProperty, "Engine");
    expectEqualAndQuiet();
}

TEST_F(TwoEditors, AnEditThatWasNotCapturedYetIsMergedWithTheVersionThatArrives) {
    edit(alice, kCXOrganizationProperty, "Engine");
    alice.pass();
    std::atomic<bool> edited = false;
    bob.wire->intercept([&](const HttpRequest& request) -> std::optional<HttpResponse> {
        const bool reads =
            request.url.encodedPath().find(std::string(cxUUIDPart(people[0]->uniqueId()))) != std::string::npos;
        if (request.method == "GET" && reads && !edited.exchange(true)) edit(bob, kCXNicknameProperty, "Countess");
        return std::nullopt;
    });
    bob.pass();
    ASSERT_TRUE(edited);
    EXPECT_EQ(valueOf(bob, kCXOrganizationProperty), Value("Engine")) << log.text();
    EXPECT_EQ(valueOf(bob, kCXNicknameProperty), Value("Countess")) << log.text();
    bob.database->deliverExternalChanges();
    settle();
    expectEverywhere(kCXOrganizationProperty, "Engine");
    expectEverywhere(kCXNicknameProperty, "Countess");
    expectEqualAndQuiet();
}

TEST_F(TwoEditors, OfTwoValuesOfOnePropertyTheLaterStaysAndTheOtherIsNoted) {
    edit(bob, kCXNoteProperty, "Bob's");
    bob.pass();
    setDate(fileOf(people[0]), dateOf(fileOf(people[0])) - 100);
    edit(alice, kCXNoteProperty, "Alice's");
    settle();
    expectEverywhere(kCXNoteProperty, "Alice's");
    const auto noted = alice.database->conflicts();
    ASSERT_EQ(noted.size(), 1u) << log.text();
    EXPECT_EQ(noted[0].merge.lost[kCXNoteProperty], Value("Bob's"));
    EXPECT_EQ(noted[0].uniqueId, people[0]->uniqueId());
    expectEqualAndQuiet();

    edit(bob, kCXNoteProperty, "Bob's second");
    bob.pass();
    edit(alice, kCXNoteProperty, "Alice's second");
    Sqlite(alice.directory / "contacts.db", 1000).execute("UPDATE common SET edited=edited-100");
    settle();
    expectEverywhere(kCXNoteProperty, "Bob's second");
    ASSERT_EQ(alice.database->conflicts().size(), 2u);
    EXPECT_EQ(alice.database->conflicts()[1].merge.lost[kCXNoteProperty], Value("Alice's second"));
}

TEST_F(TwoEditors, AContactThatOnlyJoinsAGroupDoesNotTakeAnothersEditBack) {
    edit(bob, kCXOrganizationProperty, "Engine", 1);
    bob.pass();
    friends->addMember(people[1]);
    alice.application->save();
    settle();
    EXPECT_EQ(people[1]->valueForProperty(kCXOrganizationProperty), Value("Engine")) << log.text();
    expectEqualAndQuiet();
}

TEST_F(TwoEditors, AnEditThatTheQueueGaveUpIsSentByTheNextPass) {
    edit(alice, kCXNicknameProperty, "Countess");
    alice.preferences.set(kDaemonDomain, CXDCXConduit::kLastSyncDateKey, Date(Date::distantFuture()));
    settle(); // no scan by date finds it
    expectEverywhere(kCXNicknameProperty, "Countess");
    expectEqualAndQuiet();
}

TEST_F(TwoEditors, WhoIsFasterBetweenReadingAndWritingIsMergedToo) {
    edit(bob, kCXOrganizationProperty, "Engine");
    bob.pass();
    edit(alice, kCXNicknameProperty, "Countess");
    int left = 2;
    alice.wire->intercept([&](const HttpRequest& request) -> std::optional<HttpResponse> {
        const bool isTheFile =
            request.url.encodedPath().find(std::string(cxUUIDPart(people[0]->uniqueId()))) != std::string::npos;
        if (request.method == "PUT" && isTheFile && left-- > 0)
            writeElsewhere(people[0], "First " + std::to_string(left));
        return std::nullopt;
    });
    settle();
    expectEverywhere(kCXFirstNameProperty, "First 0");
    expectEverywhere(kCXOrganizationProperty, "Engine");
    expectEverywhere(kCXNicknameProperty, "Countess");
    expectEqualAndQuiet();
}

TEST_F(TwoEditors, AContactThatIsDeletedBeforeItIsMergedDoesNotBecomeThePersonsOwn) {
    edit(alice, kCXNicknameProperty, "Countess");
    alice.pass();
    edit(bob, kCXOrganizationProperty, "Engine");
    std::atomic<bool> isDeleted = false;
    bob.wire->intercept([&](const HttpRequest& request) -> std::optional<HttpResponse> {
        if (request.method == "LOCK" && !isDeleted.exchange(true)) { // the edit is on its way
            bob.application->removeRecord(bob.copyOf(people[0]));
            bob.application->save();
        }
        return std::nullopt;
    });
    bob.pass();
    ASSERT_TRUE(isDeleted) << bob.wire->text();
    EXPECT_EQ(bob.database->countPeople(RemoteLocation("")), 0u) << log.text();
    bob.database->deliverExternalChanges();
    settle();
    EXPECT_EQ(bob.database->countPeople(RemoteLocation("")), 0u) << log.text();
    EXPECT_FALSE(person(bob));
    EXPECT_FALSE(alice.application->recordForUniqueId(people[0]->uniqueId())) << log.text();
    EXPECT_EQ(copies(), alice.view()) << log.text();
}

// A tree that has lost something is no older copy: the contacts that lie there are everybody's latest.
TEST_F(TwoEditors, InATreeThatHasLostAGroupBothEditsAreKept) {
    const auto loseTheGroup = [&] { std::filesystem::remove_all(world->file(friends->uniqueId().str())); };
    for (Participant* first : {&alice, &bob}) {
        Participant* second = first == &alice ? &bob : &alice;
        edit(*first, kCXOrganizationProperty, "O" + first->name);
        first->pass();
        loseTheGroup();
        edit(*second, kCXNicknameProperty, "N" + first->name);
        second->pass();
        EXPECT_TRUE(log.mentions("has lost a group that it still names")) << log.text();
        settle();
        settle();
        expectEverywhere(kCXOrganizationProperty, "O" + first->name);
        expectEverywhere(kCXNicknameProperty, "N" + first->name);
        expectEqualAndQuiet();
    }
}

class RenamedDuringThePass : public TwoEditors {
protected:
    CXGroupRef copy() {
        return std::dynamic_pointer_cast<CXGroup>(
            bob.application->recordForUniqueId(cxUIDWithTableName(friends->uniqueId(), kCXSubscribedGroupTable)));
    }
    static void rename(Participant& user, const CXGroupRef& group, const char* name) {
        group->setValue(Value(name), kCXGroupNameProperty);
        user.application->save();
    }
    void expectName(const char* name) {
        EXPECT_EQ(copy()->name(), name) << log.text();
        bob.database->deliverExternalChanges();
        settle();
        EXPECT_EQ(copy()->name(), name) << log.text();
        EXPECT_EQ(friends->name(), name) << log.text();
        expectEqualAndQuiet();
    }
};

TEST_F(RenamedDuringThePass, AGroupKeepsTheNameThatItWasGivenBeforeAnotherOneArrived) {
    rename(alice, friends, "Owner's");
    edit(alice, kCXNicknameProperty, "Countess");
    alice.pass();
    std::atomic<bool> renamed = false;
    bob.wire->intercept([&](const HttpRequest& request) -> std::optional<HttpResponse> {
        const bool reads =
            request.url.encodedPath().find(std::string(cxUUIDPart(people[0]->uniqueId()))) != std::string::npos;
        if (request.method == "GET" && reads && !renamed.exchange(true)) rename(bob, copy(), "Writer's");
        return std::nullopt;
    });
    bob.pass();
    ASSERT_TRUE(renamed);
    expectName("Writer's");
}

TEST_F(RenamedDuringThePass, AGroupKeepsTheNameThatItWasGivenBeforeThePassWasSaved) {
    rename(alice, friends, "Owner's");
    alice.pass();
    bool renamed = false;
    bob.progress.processed = [&](const CXDChangeRecordPtr& record) {
        if (record->type() == CXDChangeGroupName && !std::exchange(renamed, true)) rename(bob, copy(), "Writer's");
    };
    bob.pass();
    ASSERT_TRUE(renamed);
    expectName("Writer's");
}

// -- thousands of rounds, of which the suite makes a few

namespace {
class DiskEnds { // nothing reaches the disk from the given write on
public:
    explicit DiskEnds(int write) {
        left = write;
        interceptWrites([] { return left-- > 0; });
    }
    ~DiskEnds() { interceptWrites(nullptr); }
    DiskEnds(const DiskEnds&) = delete;
    DiskEnds& operator=(const DiskEnds&) = delete;
    static std::atomic<int> left;
};
std::atomic<int> DiskEnds::left = 0;

int numberFrom(const char* variable, int otherwise) {
    const char* text = std::getenv(variable);
    return text ? std::atoi(text) : otherwise;
}
} // namespace

// Each of the two changes properties of the own, in any order with passes, off line or not, and killed behind any
// write of a pass. Nothing of either may be lost.
class RandomEditors : public TwoUsers {
protected:
    RandomEditors() {
        user[0] = std::make_unique<Participant>(*world, "alice", alice.directory.path());
        user[1] = std::make_unique<Participant>(*world, "bob", bob.directory.path());
        pass(1);
        pass(0);
    }
    CXPersonRef person(size_t who) {
        return who == 0
                   ? std::dynamic_pointer_cast<CXPerson>(user[0]->application->recordForUniqueId(people[0]->uniqueId()))
                   : user[1]->copyOf(people[0]);
    }
    void pass(size_t who) {
        try {
            user[who]->pass();
        } catch (const CXException&) { // so it ends
        }
    }
    void kill(size_t who, int write) {
        {
            const DiskEnds end(write);
            pass(who);
        }
        auto next = std::make_unique<Participant>(*world, user[who]->name, user[who]->directory.path());
        user[who]->engine.reset();
        user[who] = std::move(next);
        ++kills;
    }
    std::unique_ptr<Participant> user[2];
    int kills = 0;
};

TEST_F(RandomEditors, LoseNothingOfEitherSide) {
    const int rounds = numberFrom("ROLVANE_TEST_ROUNDS", 40);
    const unsigned seed = static_cast<unsigned>(numberFrom("ROLVANE_TEST_SEED", 20261122));
    std::mt19937 random(seed);
    SCOPED_TRACE("seed " + std::to_string(seed));
    const char* single[2][3] = {{kCXNicknameProperty, kCXNoteProperty, kCXJobTitleProperty},
                                {kCXOrganizationProperty, kCXDepartmentProperty, kCXMiddleNameProperty}};
    std::map<std::string, std::string> wanted;
    std::set<std::string> phones;
    for (int round = 0; round < rounds && !HasFailure(); ++round) {
        SCOPED_TRACE("round " + std::to_string(round));
        for (size_t step = 0, steps = 2 + random() % 6; step < steps; ++step) {
            const size_t who = random() % 2;
            switch (random() % 6) {
            case 0:
            case 1: {
                const char* property = single[who][random() % 3];
                const std::string value = user[who]->name + " " + std::to_string(round) + "." + std::to_string(step);
                person(who)->setValue(Value(value), property);
                user[who]->application->save();
                wanted[property] = value;
                break;
            }
            case 2: {
                CXMutableMultiValue all(person(who)->multiValueForProperty(kCXPhoneProperty).value_or(CXMultiValue()));
                const std::string value = user[who]->name + std::to_string(round) + "." + std::to_string(step);
                size_t own = all.count(); // one of the own is replaced
                for (size_t i = 0; i < all.count(); ++i)
                    if (all.valueAtIndex(i).string().starts_with(user[who]->name)) own = i;
                if (own < all.count() && random() % 2) {
                    phones.erase(all.valueAtIndex(own).string());
                    all.replaceValueAtIndex(own, value);
                } else {
                    all.addValue(value, "work");
                }
                phones.insert(value);
                person(who)->setValue(all, kCXPhoneProperty);
                user[who]->application->save();
                break;
            }
            case 3: user[who]->network.reachable = !user[who]->network.reachable; break;
            case 4: kill(who, static_cast<int>(random() % 25)); break;
            default: pass(who);
            }
        }
        for (const auto& each : user) each->network.reachable = true;
        for (const size_t who : {0, 1, 0, 1, 0, 1}) pass(who);
        for (const size_t who : {size_t{0}, size_t{1}}) {
            for (const auto& [property, value] : wanted)
                EXPECT_EQ(person(who)->valueForProperty(property), Value(value)) << who << property << "\n"
                                                                                 << log.text();
            std::set<std::string> numbers;
            const CXMultiValue there = *person(who)->multiValueForProperty(kCXPhoneProperty);
            for (const auto& entry : there.entries()) numbers.insert(entry.value.string());
            for (const std::string& phone : phones)
                EXPECT_TRUE(numbers.contains(phone)) << who << " " << phone << "\n" << log.text();
            EXPECT_EQ(numbers.size(), phones.size() + 1) << who << "\n" << log.text();
        }
        EXPECT_EQ(user[1]->view(user[1 - 1]->base), user[0]->view());
        // A pass that is killed behind its write does not know its own former value from somebody else's.
        for (const auto& each : user)
            for (const CXConflict& conflict : each->database->conflicts()) {
                const std::string& property = conflict.merge.property;
                EXPECT_NE(conflict.merge.lost[property], Value(wanted[property])) << log.text();
            }
        log.clear();
    }
    std::printf("%d rounds, %d kills\n", rounds, kills);
}

} // namespace rolvane::test
