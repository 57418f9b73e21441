#include "TestDatabase.h"

#include "support/CapturingLog.h"

#include <sstream>

#include <rapidcheck/gtest.h>

namespace rolvane::test {
namespace {

// Everything that the queries tell, as text. Dates only as far as a save does not change them.
std::string everything(CXRolvane& d) {
    std::ostringstream out;
    auto list = [&](const char* what, const std::vector<UniqueId>& uids) {
        out << "  " << what;
        for (const UniqueId& uid : uids) out << " " << uid.str();
        out << "\n";
    };
    std::vector<CXGroupRef> groups = d.allGroup()->subgroups();
    std::vector<UniqueId> people = d.allGroup()->memberUniqueIds();
    groups.push_back(d.allGroup());
    for (const auto& s : d.subscriptions()) {
        out << "subscription " << s->remoteLocation().str() << " " << s->name() << "\n";
        if (s->isLocal()) continue;
        CXAllGroupRef all = d.allGroupForRemoteLocation(s->remoteLocation());
        for (const auto& g : all->subgroups()) groups.push_back(g);
        for (const UniqueId& uid : all->memberUniqueIds()) people.push_back(uid);
        groups.push_back(all);
    }
    for (const auto& g : groups) {
        out << "group " << g->description() << "\n";
        list("members", g->memberUniqueIds());
        list("subgroups", g->subgroupIdentifiers());
        EXPECT_EQ(g->memberCount(), g->memberUniqueIds().size());
        for (const auto& [person, choices] : g->distributionChoices())
            for (const auto& [property, identifier] : choices)
                out << "  choice " << person.str() << " " << property << " " << identifier << "\n";
    }
    for (const UniqueId& uid : people) {
        auto person = std::dynamic_pointer_cast<CXPerson>(d.recordForUniqueId(uid));
        out << "person " << person->description() << "\n";
        list("parents", person->parentGroupUniqueIds());
        for (const auto& [group, choices] : CXGroup::distributionChoicesForPerson(*person))
            for (const auto& [property, identifier] : choices)
                out << "  chosen " << group.str() << " " << property << " " << identifier << "\n";
    }
    for (std::string_view table : {kCXPersonTable, kCXSubscribedPersonTable}) {
        std::map<UniqueId, size_t> scanned;
        d.forEachPersonModifiedSince(Date::distantPast(), table,
                                     [&](const CXRow& row) { scanned[row.uniqueId] = row.parentGroups.size(); });
        for (const auto& [uid, parents] : scanned) out << "scanned " << uid.str() << " " << parents << "\n";
    }
    for (const CXListing& l : d.listPeople(std::nullopt)) out << "listed " << l.displayName << "\n";
    for (const CXListing& l : d.listGroups(std::nullopt)) out << "listed " << l.displayName << "\n";
    out << d.countPeople(std::nullopt) << " people, share count " << d.shareCount() << "\n";
    return out.str();
}

const std::vector<std::string> kLocations{"http://s/bob/Contacts", "http://s/carol/Contacts"};

// One random change, through the public face, on records of a small world so that changes meet each other.
void change(CXRolvane& d) {
    auto number = [](int below) { return *rc::gen::inRange(0, below); };
    auto personId = [&] {
        int n = number(6);
        return UniqueId("P" + std::to_string(n) + (n < 4 ? ":CXPerson" : ":CXSubscribedPerson"));
    };
    auto groupId = [&] {
        int n = number(4);
        return UniqueId("G" + std::to_string(n) + (n < 3 ? ":CXGroup" : ":CXSubscribedGroup"));
    };
    auto person = std::dynamic_pointer_cast<CXPerson>(d.recordForUniqueId(personId()));
    auto group = std::dynamic_pointer_cast<CXGroup>(d.recordForUniqueId(groupId()));
    auto other = std::dynamic_pointer_cast<CXGroup>(d.recordForUniqueId(groupId()));
    std::string text = std::to_string(number(3));
    std::string location = kLocations[static_cast<size_t>(number(2))];
    switch (number(15)) {
    case 0:
    case 1: {
        CXPersonRef made = CXPerson::initWithUniqueId(personId());
        made->setValue(text, kCXFirstNameProperty);
        if (made->isSubscribed()) made->setValue(TestDatabase::from(location), kCXRemoteLocationProperty);
        return d.addRecord(made);
    }
    case 2: {
        CXGroupRef made = CXGroup::initWithUniqueId(groupId());
        made->setValue(text, kCXGroupNameProperty);
        if (made->isSubscribed()) made->setValue(TestDatabase::from(location), kCXRemoteLocationProperty);
        return d.addRecord(made);
    }
    case 3:
        if (person) d.removeRecord(person);
        return;
    case 4:
        if (group) d.removeRecord(group);
        return;
    case 5:
        if (person) person->setValue(text, number(2) ? kCXFirstNameProperty : kCXEmailProperty);
        return;
    case 6:
        if (person) person->removeValueForProperty(kCXEmailProperty);
        return;
    case 7:
        if (person) person->resetWithDictionary({{"First", text}, {"Email", "x"}}, false, false);
        return;
    case 8:
    case 9:
        if (person && group) group->addMember(person);
        return;
    case 10:
        if (person && group) group->removeMember(person);
        return;
    case 11:
        try {
            if (group && other) group->addSubgroup(other);
        } catch (const CXException&) { // a cycle
        }
        return;
    case 12:
        if (group && other) group->removeSubgroup(other);
        return;
    case 13:
        if (person && group)
            group->setDistributionIdentifier(number(3) ? std::optional(text) : std::nullopt, kCXEmailProperty, person);
        return;
    case 14: {
        CXSubscriptionRef there = d.findSubscriptionWithRemoteLocation(RemoteLocation(location));
        if (there && number(2)) d.removeRecord(there);
        if (!there) d.addRecord(CXSubscription::create(RemoteLocation(location)));
        return;
    }
    }
}

// Random worlds are many and die young: they need no disk that lasts.
struct InMemory {
    InMemory() {
        if (::access("/dev/shm", W_OK) == 0) home.setVariable("TMPDIR", "/dev/shm");
    }
    TempHome home;
};

RC_GTEST_PROP(UnitOfWork, QueriesTellTheSameBeforeAndAfterTheSave, ()) {
    InMemory memory;
    TestDatabase d;
    for (int round = 0; round < 2; round++) {
        int changes = *rc::gen::inRange(1, 25);
        for (int i = 0; i < changes; i++) change(*d);
        std::string before = everything(*d);
        d->save();
        RC_ASSERT(everything(*d) == before);
        RC_ASSERT(everything(*d.open("rolvane")) == before);
    }
}

RC_GTEST_PROP(UnitOfWork, ARollbackGoesBackToWhatIsStored, ()) {
    InMemory memory;
    TestDatabase d;
    for (int i = 0; i < 20; i++) change(*d);
    d->save();
    std::string stored = everything(*d);
    for (int i = 0; i < 20; i++) change(*d);
    d->rollback();
    RC_ASSERT(everything(*d) == stored);
    RC_ASSERT(!d->hasUnsavedChanges());
}

RC_GTEST_PROP(UnitOfWork, TwoProcessesThatSaveInTurnSeeTheSameInTheEnd, ()) {
    InMemory memory;
    TestDatabase d;
    CapturingLog quiet;
    auto app = d.open("rolvane");
    for (int round = 0; round < 2; round++) {
        for (int i = 0; i < 12; i++) {
            change(*d);
            change(*app);
        }
        try {
            d->save();
            app->save();
        } catch (const CXException& e) {
            RC_FAIL(std::string(e.what()));
        }
        RC_ASSERT(everything(*d) == everything(*app));
        std::set<RemoteLocation> locations;
        for (const auto& s : d->subscriptions()) RC_ASSERT(locations.insert(s->remoteLocation()).second);
    }
}

TEST(UnitOfWork, ChangesOfTwoProcessesToDifferentPropertiesAreBothKept) {
    TestDatabase d;
    CXPersonRef a = d.addPerson("A");
    d->save();
    auto app = d.open("rolvane");
    CXRecordRef there = app->recordForUniqueId(a->uniqueId());
    a->setValue("mine", kCXNoteProperty);
    there->setValue("theirs", kCXNicknameProperty);
    d->save();
    app->save();
    EXPECT_EQ(a->valueForProperty(kCXNoteProperty).string(), "mine");
    EXPECT_EQ(a->valueForProperty(kCXNicknameProperty).string(), "theirs");
    EXPECT_EQ(there->dictionaryRepresentation(), a->dictionaryRepresentation());
}

// A save may wait for another one, and what that one has written into the same list is not taken away.
TEST(UnitOfWork, ChangesOfTwoProcessesToOneListOfAPersonAreBothKept) {
    TestDatabase db;
    const auto list = [](const std::vector<std::string>& values) {
        CXMutableMultiValue multi;
        for (const std::string& value : values) multi.addValue(value, kCXHomeLabel);
        return multi.toValue();
    };
    const auto added = [](const CXPersonRef& person, const std::string& value) {
        CXMutableMultiValue multi;
        const auto before = person->multiValueForProperty(kCXEmailProperty);
        for (const auto& entry : before->entries()) multi.addValue(entry.value, entry.label, entry.identifier);
        multi.addValue(value, kCXHomeLabel);
        person->setValue(multi.toValue(), kCXEmailProperty);
    };
    const auto values = [](const CXPersonRef& person) {
        std::set<std::string> all;
        const auto multi = person->multiValueForProperty(kCXEmailProperty);
        for (const auto& entry : multi->entries()) all.insert(entry.value.string());
        return all;
    };
    const auto ours = db.addPerson("Ann");
    ours->setValue(list({"a", "b"}), kCXEmailProperty);
    db->save();
    auto other = db.open("other");
    const auto theirs = std::dynamic_pointer_cast<CXPerson>(other->recordForUniqueId(ours->uniqueId()));
    added(ours, "ours");
    ours->setValue("our note", kCXNoteProperty);
    added(theirs, "theirs");
    theirs->setValue("their note", kCXNoteProperty);
    other->save();
    db->save();
    EXPECT_EQ(values(ours), (std::set<std::string>{"a", "b", "ours", "theirs"}));
    EXPECT_EQ(values(theirs), values(ours));
    EXPECT_EQ(ours->valueForProperty(kCXNoteProperty).string(), "our note") << "the later save's";
    ASSERT_EQ(db->conflicts().size(), 1u) << "and the other one can be put back";
    EXPECT_EQ(db->conflicts()[0].merge.lost[kCXNoteProperty].string(), "their note");
    // What one takes away of a list leaves what the other has added.
    ours->setValue(list({"a"}), kCXEmailProperty);
    added(theirs, "more");
    other->save();
    db->save();
    EXPECT_EQ(values(ours), (std::set<std::string>{"a", "more"}));
}

TEST(UnitOfWork, AReadSeesWhatAnotherProcessHasSaved) {
    TestDatabase d;
    CXPersonRef a = d.addPerson("A");
    d->save();
    EXPECT_EQ(a->valueForProperty(kCXFirstNameProperty).string(), "A");
    auto app = d.open("rolvane");
    app->recordForUniqueId(a->uniqueId())->setValue("B", kCXFirstNameProperty);
    EXPECT_EQ(a->valueForProperty(kCXFirstNameProperty).string(), "A");
    app->save();
    EXPECT_EQ(a->valueForProperty(kCXFirstNameProperty).string(), "B");
    app->removeRecord(app->recordForUniqueId(a->uniqueId()));
    app->save();
    EXPECT_FALSE(a->isAttached());
    EXPECT_TRUE(a->valueForProperty(kCXFirstNameProperty).isAbsent());
}

TEST(UnitOfWork, AChangeToARecordThatAnotherProcessRemovedIsDropped) {
    TestDatabase d;
    CXPersonRef a = d.addPerson("A");
    d->save();
    auto app = d.open("rolvane");
    a->setValue("x", kCXNoteProperty);
    app->removeRecord(app->recordForUniqueId(a->uniqueId()));
    app->save();
    CapturingLog log;
    EXPECT_NO_THROW(d->save());
    EXPECT_TRUE(log.mentions("was removed by another program")) << log.text();
    EXPECT_EQ(d->countPeople(std::nullopt), 0u);
    EXPECT_FALSE(d->hasUnsavedChanges());
}

TEST(UnitOfWork, NothingUnsavedIsNoSave) {
    TestDatabase d;
    int64_t end = d->journalPosition();
    EXPECT_TRUE(d->save());
    CXPersonRef a = d.addPerson("A");
    d->removeRecord(a);
    EXPECT_FALSE(d->hasUnsavedChanges()) << "added and removed again: nothing is left to write";
    EXPECT_TRUE(d->save());
    EXPECT_EQ(d->journalPosition(), end);
}

} // namespace
} // namespace rolvane::test
