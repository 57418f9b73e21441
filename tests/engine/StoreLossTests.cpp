// Stores that lose a part of what they held, or all of it, or what was written since some backup.

#include "TwoUsers.h"
#include "model/PayloadKeys.h"
#include "support/WaitUntil.h"

#include <ctime>
#include <set>

namespace rolvane::test {

class StoreLoss : public TwoUsers {
protected:
    std::filesystem::path tree() { return world->file(); }
    // Until nothing more can travel; the owner's daemon comes first.
    void settle() {
        for (int i = 0; i < 3; ++i) {
            alice.pass();
            bob.pass();
        }
    }
    // With owners and dates, as an archive keeps them.
    static void copyTree(const std::filesystem::path& from, const std::filesystem::path& to) {
        std::filesystem::remove_all(to);
        ASSERT_EQ(std::system(("cp -a '" + from.string() + "' '" + to.string() + "'").c_str()), 0);
    }
    // A copy of the tree, made an hour ago.
    void backUp() {
        constexpr int64_t kHour = 3600;
        copyTree(tree(), backup);
        for (const auto& entry : std::filesystem::recursive_directory_iterator(backup))
            setDate(entry.path(), dateOf(entry.path()) - kHour);
    }
    enum class Dates { kept, lost };
    void restore(Dates dates) {
        copyTree(backup, tree());
        if (dates == Dates::kept) return;
        newDate = std::time(nullptr) + 1; // no second in which any of it was written before
        for (const auto& entry : std::filesystem::recursive_directory_iterator(tree())) setDate(entry.path(), newDate);
    }
    // Things that happen after the backup.
    void change() {
        people[0]->setValue(Value("Adelheid"), kCXFirstNameProperty);
        people.push_back(alice.add("Dora"));
        friends->addMember(people[1]);
        alice.group("Family", {people[3]});
        alice.application->save();
        settle();
        ASSERT_EQ(copies(), alice.view());
    }
    void editOfBobs() {
        bob.copyOf(people[1])->setValue(Value("Benjamin"), kCXFirstNameProperty);
        bob.application->save();
        settle();
        ASSERT_EQ(firstName(people[1]), Value("Benjamin"));
    }
    void removals() {
        friends->removeMember(people[2]);
        alice.application->removeRecord(people[0]);
        people.erase(people.begin());
        alice.application->save();
        settle();
        ASSERT_EQ(copies(), alice.view());
    }
    void nobodyMayWrite() {
        for (const char* list : {kCXReadSharingACLProperty, kCXReadWriteSharingACLProperty})
            alice.application->allGroup()->removeValueForProperty(list);
        alice.application->save();
        alice.start(); // the list of writers is looked at once
    }
    void expectStoreHoldsEverything() {
        for (const CXPersonRef& person : people)
            EXPECT_EQ(contentOf(fileOf(person))[kCXFirstNameProperty], firstName(person)) << log.text();
        Participant late{*world, "bob"};
        late.subscribe(alice);
        late.pass();
        EXPECT_EQ(late.view(alice.base), alice.view()) << "a new subscriber\n" << log.text();
    }
    void expectNothingLost(const std::map<std::string, std::string>& before) {
        EXPECT_EQ(alice.view(), before) << log.text();
        EXPECT_EQ(copies(), before) << log.text();
    }
    void expectWriters(const std::vector<std::string>& expected) {
        std::vector<std::string> readers, writers;
        ASSERT_TRUE(alice.manager.ACLsAtURL(Url(alice.base).withScheme("https"), readers, writers));
        EXPECT_EQ(writers, expected) << "on the store";
        EXPECT_EQ(readers, expected) << "on the store";
        const auto ours = alice.application->allGroup()->multiValueForProperty(kCXReadWriteSharingACLProperty);
        EXPECT_EQ(ours ? ours->count() : 0, expected.size()) << "in the database";
    }
    // A subscriber waits for a visit of the owner's that is dated after the copy, so a copy with new dates may still
    // be waited for: until then nothing of what the owner has written again is read.
    void awaitVisitAfterTheCopy() {
        EXPECT_TRUE(waitUntil([&] { return std::time(nullptr) > newDate; }, "the second after the copy's"));
        alice.pass();
        bob.pass();
    }
    // The contacts that Bob has read, each as often as he has.
    std::multiset<std::string> readByBob() {
        std::multiset<std::string> names;
        for (const auto& exchange : bob.wire->exchanges())
            if (exchange.method == "GET" && exchange.path.find("/People/") != std::string::npos)
                names.insert(Url::percentDecode(exchange.path.substr(exchange.path.rfind('/') + 1)));
        return names;
    }
    // Gives the contacts that Bob has read on the way.
    std::set<std::string> expectMended(const std::map<std::string, std::string>& before) {
        bob.wire->clear();
        bob.pass(); // before the owner has seen it
        expectNothingLost(before);
        for (int i = 0; i < 3; ++i) {
            alice.pass();
            EXPECT_EQ(alice.view(), before) << log.text();
        }
        settle();
        expectNothingLost(before);
        expectStoreHoldsEverything();
        EXPECT_TRUE(alice.engine->getPendingChanges().empty());
        if (newDate != 0) awaitVisitAfterTheCopy();
        const auto reads = readByBob();
        const std::set<std::string> read(reads.begin(), reads.end());
        EXPECT_EQ(reads.size(), read.size()) << "once each\n" << bob.wire->text();
        for (Participant* each : {&alice, &bob}) expectQuietPass(*each);
        EXPECT_TRUE(bob.alert.told.empty());
        return read;
    }

    std::time_t newDate = 0; // of the copy that is there now, if it has got one
    TempDirectory place;
    const std::filesystem::path backup = place / "backup";
};

// -- a change of a list that meets no list

class LostLists : public StoreLoss {
protected:
    std::filesystem::path stateOf(const std::string& name) {
        const std::filesystem::path file = world->file(name);
        return std::filesystem::is_directory(file) ? file / CXDAVManager::kStateName : file;
    }
    std::filesystem::path list() { return stateOf(std::string(kCXAllGroupUID)); }
    // The change reaches the store in a pass that does not look at the tree.
    static void send(Participant& whose) {
        whose.wire->clear();
        EXPECT_TRUE(whose.database->deliverExternalChanges());
        EXPECT_GT(whose.wire->count("PUT"), 0u) << whose.wire->text();
    }
    static std::set<std::string> membersIn(const std::filesystem::path& file) {
        std::set<std::string> members;
        for (const Value& member : contentOf(file)[kMemberUIDState].array()) members.insert(member.string());
        return members;
    }
};

TEST_F(LostLists, TheOwnersChangeOfTheListIsWrittenWithTheWholeList) {
    nobodyMayWrite();
    settle();
    std::filesystem::remove(list());
    people.push_back(alice.add("Dora"));
    send(alice);
    ASSERT_TRUE(std::filesystem::exists(list())) << alice.wire->text();
    EXPECT_EQ(membersIn(list()).size(), 4u) << textOf(list());
    EXPECT_EQ(contentOf(list())[kSubgroupUIDState].array().count(), 1u) << textOf(list());
    settle();
    EXPECT_EQ(copies(), alice.view()) << log.text();
    EXPECT_EQ(alice.countPeople(), 4u);
}

TEST_F(LostLists, TheOwnersChangeOfAGroupIsWrittenWithTheWholeGroup) {
    nobodyMayWrite();
    settle();
    const std::filesystem::path state = stateOf(friends->uniqueId().str());
    std::filesystem::remove(state);
    friends->addMember(people[1]);
    alice.application->save();
    send(alice);
    ASSERT_TRUE(std::filesystem::exists(state)) << alice.wire->text();
    EXPECT_EQ(membersIn(state).size(), 3u) << textOf(state);
    EXPECT_EQ(contentOf(state)[kCXGroupNameProperty], Value("Friends"));
    settle();
    EXPECT_EQ(copies(), alice.view()) << log.text();
}

TEST_F(LostLists, AWritersChangeOfTheListWaitsForTheOwners) {
    settle();
    ASSERT_EQ(copies(), alice.view());
    std::filesystem::remove(list());
    bob.application->removeRecord(bob.copyOf(people[1]));
    bob.application->save();
    EXPECT_TRUE(bob.database->deliverExternalChanges());
    EXPECT_FALSE(std::filesystem::exists(list())) << "a writer makes no list\n" << bob.wire->text();
    EXPECT_FALSE(bob.engine->getPendingChanges().empty());
    settle();
    settle();
    EXPECT_GE(alice.countPeople(), 2u) << log.text();
    EXPECT_EQ(copies(), alice.view()) << log.text();
    EXPECT_TRUE(bob.engine->getPendingChanges().empty());
}

// Another program, or an older one of somebody's, has written it so.
TEST_F(LostLists, AListThatHoldsOneChangeAloneTakesNobodyOutOfAnyDatabase) {
    settle();
    const auto before = alice.view();
    rewrite(list(), PropertyList::toXML(Dictionary{{kMemberUIDState, Array{CXPerson::create()->uniqueId().str()}}}));
    bob.pass();
    EXPECT_EQ(copies(), before) << log.text();
    settle();
    settle();
    expectNothingLost(before);
    EXPECT_GE(membersIn(list()).size(), 3u) << textOf(list());
}

// -- a store that was restored from an older copy

TEST_F(StoreLoss, AnOlderCopyOfTheTreeTakesNothingFromAnybodyAndTheOwnersDaemonMendsIt) {
    for (const Dates dates : {Dates::kept, Dates::lost}) {
        SCOPED_TRACE(dates == Dates::kept ? "dates kept" : "dates lost");
        settle();
        backUp();
        change();
        editOfBobs();
        const auto before = alice.view();
        restore(dates);
        // The owner's text has taken the place of his own; all else is to the byte what he has read before.
        EXPECT_EQ(expectMended(before), std::set<std::string>{people[1]->uniqueId().str()});
        people[1]->setValue(Value("Ben"), kCXFirstNameProperty);
        alice.application->save();
        settle();
    }
}

TEST_F(StoreLoss, WhereNobodyElseMayWriteAnOlderCopyBecomesWhatTheOwnerHas) {
    settle();
    backUp();
    change();
    removals();
    nobodyMayWrite();
    settle();
    expectWriters({});
    const auto before = alice.view();
    restore(Dates::kept);
    expectMended(before);
    expectWriters({}); // although the copy is of a time when somebody was
}

TEST_F(StoreLoss, WhereOthersMayWriteWhatWasDeletedSinceAnOlderCopyComesBackAndNothingElse) {
    settle();
    backUp();
    change();
    const CXPersonRef deleted = people[0], notAMember = people[2];
    removals();
    const auto before = alice.view();
    restore(Dates::kept);
    settle();
    auto after = alice.view();
    EXPECT_EQ(copies(), after) << log.text();
    EXPECT_EQ(after.erase("person " + deleted->uniqueId().str()), 1u) << "nobody can tell that it was deleted";
    EXPECT_EQ(friends->memberUniqueIds().size(), 3u);
    alice.application->removeRecord(alice.application->recordForUniqueId(deleted->uniqueId()));
    friends->removeMember(notAMember);
    alice.application->save();
    settle();
    expectNothingLost(before);
}

TEST_F(StoreLoss, WhileTheOwnersWritesFailAnOlderCopyIsNotTakenForNews) {
    settle();
    backUp();
    change();
    const auto before = alice.view();
    restore(Dates::kept);
    std::atomic<bool> full = true;
    alice.wire->intercept([&](const HttpRequest& request) {
        return full && request.method == "PUT" ? std::optional(answerOf(507)) : std::nullopt;
    });
    settle();
    expectNothingLost(before);
    full = false;
    expectMended(before);
}

// -- a store that was emptied

TEST_F(StoreLoss, ATreeOfWhichOnlyTheSerialNumberIsLeftIsFilledAgain) {
    settle();
    change();
    const auto before = alice.view();
    for (const auto& entry : std::filesystem::directory_iterator(tree()))
        if (entry.path().filename() != "info") std::filesystem::remove_all(entry.path());
    expectMended(before);
}

TEST_F(StoreLoss, ATreeWhoseFoldersAreEmptyIsFilledAgain) {
    settle();
    change();
    const auto before = alice.view();
    for (const auto& entry : std::filesystem::recursive_directory_iterator(tree()))
        if (entry.is_regular_file() && entry.path().filename() != "info") std::filesystem::remove(entry.path());
    expectMended(before);
}

TEST_F(StoreLoss, LostContentsOfContactsAreWrittenAgain) {
    settle();
    const auto before = alice.view();
    for (const auto& entry : std::filesystem::recursive_directory_iterator(tree() / "People"))
        if (entry.is_regular_file()) std::filesystem::remove(entry.path());
    expectMended(before);
}

TEST_F(StoreLoss, ATreeThatIsGoneIsMadeAgainUnderItsSerialNumber) {
    settle();
    change();
    const auto before = alice.view();
    std::filesystem::remove_all(tree());
    alice.pass();
    expectMended(before);
    expectWriters({"bob"});
}

// Where there is nothing, not even a serial number, the subscription is over: the one thing that removes copies.
TEST_F(StoreLoss, ASubscriberWhoFindsNoTreeKeepsTheCopiesInAFileAndTheOwnerEverything) {
    bob.publish(); // a reason to live on
    settle();
    const auto before = alice.view();
    std::filesystem::remove_all(tree());
    bob.pass();
    EXPECT_EQ(bob.countPeople(alice.base), 0u);
    EXPECT_EQ(bob.withdrawn.list().size(), 1u);
    EXPECT_EQ(bob.alert.told.size(), 1u);
    settle();
    EXPECT_EQ(alice.view(), before) << log.text();
    bob.subscribe(alice);
    settle();
    expectNothingLost(before);
}

// -- a tree that has lost single lists

TEST_F(StoreLoss, ALostListOfEverybodyTakesNothingAlongAndIsWrittenAgain) {
    settle();
    const auto before = alice.view();
    ASSERT_TRUE(std::filesystem::exists(tree() / "AllCXGroup"));
    std::filesystem::remove_all(tree() / "AllCXGroup");
    expectMended(before);
    EXPECT_TRUE(std::filesystem::exists(tree() / "AllCXGroup"));
}

TEST_F(StoreLoss, AGroupsLostListTakesNoMemberAlongAndIsWrittenAgain) {
    settle();
    const auto before = alice.view();
    std::filesystem::remove_all(tree() / friends->uniqueId().str());
    expectMended(before);
}

// Of all that was published the group alone is written again.
TEST_F(StoreLoss, ALostGroupThatIsWrittenAgainBringsNobodyBackWhoWasDeletedMeanwhile) {
    settle();
    bob.application->removeRecord(bob.copyOf(people[0]));
    bob.application->save();
    bob.pass();
    std::filesystem::remove_all(tree() / friends->uniqueId().str());
    for (int i = 0; i < 3; ++i) alice.pass();
    EXPECT_TRUE(log.mentions("has lost a group that it still names")) << log.text();
    EXPECT_TRUE(std::filesystem::exists(tree() / friends->uniqueId().str())) << log.text();
    settle();
    EXPECT_EQ(alice.countPeople(), 2u) << log.text();
    EXPECT_EQ(friends->members().size(), 1u) << log.text();
    EXPECT_EQ(copies(), alice.view()) << log.text();
    EXPECT_FALSE(std::filesystem::exists(fileOf(people[0])));
}

// A killed daemon's lock keeps the writer from the list for a while, so the owner takes the group for lost.
TEST_F(StoreLoss, ADeletionOfAGroupThatIsCutOffGoesOnAndTakesNothingBack) {
    settle();
    bob.application->removeRecord(bob.copyOf(people[0]));
    bob.application->save();
    bob.pass();
    bob.application->removeRecord(
        bob.application->recordForUniqueId(cxUIDWithTableName(friends->uniqueId(), kCXSubscribedGroupTable)));
    bob.application->save();
    bool isRefused = true;
    bob.wire->intercept([&](const HttpRequest& request) -> std::optional<HttpResponse> {
        if (!isRefused || request.method != "LOCK") return std::nullopt;
        HttpResponse response;
        response.status = 423;
        return response;
    });
    bob.pass();
    ASSERT_FALSE(bob.engine->getPendingChanges().empty()) << bob.wire->text();
    ASSERT_FALSE(std::filesystem::exists(tree() / friends->uniqueId().str())) << bob.wire->text();
    for (int i = 0; i < 4; ++i) alice.pass();
    isRefused = false;
    for (int i = 0; i < 2; ++i) settle();
    EXPECT_TRUE(alice.application->listGroups(RemoteLocation()).empty()) << log.text();
    EXPECT_EQ(alice.countPeople(), 2u) << log.text();
    EXPECT_EQ(copies(), alice.view()) << log.text();
    EXPECT_TRUE(bob.engine->getPendingChanges().empty());
}

TEST_F(StoreLoss, AGroupThatAWriterDeletesIsNotTakenForALoss) {
    settle();
    bob.application->removeRecord(
        bob.application->recordForUniqueId(cxUIDWithTableName(friends->uniqueId(), kCXSubscribedGroupTable)));
    bob.application->save();
    settle();
    EXPECT_TRUE(alice.application->listGroups(RemoteLocation()).empty()) << log.text();
    EXPECT_EQ(copies(), alice.view());
}

TEST_F(StoreLoss, AWritersChangesWaitUntilTheOwnerHasMendedTheTree) {
    settle();
    const auto work = alice.group("Work", {people[0]});
    alice.application->save();
    settle();
    std::filesystem::remove_all(tree() / work->uniqueId().str());
    bob.pass();
    const auto groupHere = [&](const CXGroupRef& group) {
        return std::dynamic_pointer_cast<CXGroup>(
            bob.application->recordForUniqueId(cxUIDWithTableName(group->uniqueId(), kCXSubscribedGroupTable)));
    };
    groupHere(friends)->setValue(Value("Comrades"), kCXGroupNameProperty);
    groupHere(work)->setValue(Value("Office"), kCXGroupNameProperty);
    bob.application->removeRecord(bob.copyOf(people[1]));
    bob.application->save();
    bob.wire->clear();
    bob.pass();
    for (const char* write : {"PUT /dav/alice", "DELETE /dav/alice"})
        EXPECT_EQ(bob.wire->text().find(write), std::string::npos) << bob.wire->text();
    EXPECT_FALSE(bob.engine->getPendingChanges().empty());
    for (int i = 0; i < 3; ++i) settle();
    EXPECT_EQ(alice.countPeople(), 2u) << log.text();
    EXPECT_EQ(friends->valueForProperty(kCXGroupNameProperty), Value("Comrades")) << log.text();
    EXPECT_EQ(work->valueForProperty(kCXGroupNameProperty), Value("Office")) << log.text();
    EXPECT_EQ(copies(), alice.view()) << log.text();
    EXPECT_TRUE(bob.engine->getPendingChanges().empty());
}

// A pass of the writer's has ended between the group's file and its name.
TEST_F(StoreLoss, AWriterGoesOnDeletingAGroupWhoseFileIsGone) {
    settle();
    std::filesystem::remove_all(tree() / friends->uniqueId().str());
    bob.application->removeRecord(
        bob.application->recordForUniqueId(cxUIDWithTableName(friends->uniqueId(), kCXSubscribedGroupTable)));
    bob.application->save();
    bob.pass();
    EXPECT_TRUE(bob.engine->getPendingChanges().empty()) << log.text();
    settle();
    EXPECT_TRUE(alice.application->listGroups(RemoteLocation()).empty()) << log.text();
    EXPECT_EQ(copies(), alice.view());
}

TEST_F(StoreLoss, AWriterGoesOnDeletingAllContactsWhoseFilesAreGone) {
    settle();
    for (const CXPersonRef& person : people) {
        std::filesystem::remove(fileOf(person));
        bob.application->removeRecord(bob.copyOf(person));
    }
    bob.application->save();
    bob.pass();
    EXPECT_TRUE(bob.engine->getPendingChanges().empty()) << log.text();
    settle();
    EXPECT_EQ(alice.countPeople(), 0u) << log.text();
    EXPECT_EQ(copies(), alice.view());
}

} // namespace rolvane::test
