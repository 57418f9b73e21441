#include "TestDatabase.h"

#include "contacts/database/ChangeLog.h"
#include "contacts/database/History.h"
#include "contacts/records/PersonJoining.h"
#include "foundation/PropertyList.h"
#include "foundation/Sqlite.h"

#include <algorithm>
#include <fstream>
#include <sstream>

namespace rolvane::test {
namespace {

struct History : testing::Test {
    TestDatabase d;
    CXHistory history{*d};
    CXPersonRef ada, cleo;
    CXGroupRef family, cousins;

    History() {
        ada = d.addPerson("Ada");
        cleo = d.addPerson("Cleo");
        family = d.addGroup("Family");
        cousins = d.addGroup("Cousins");
        family->addMember(ada);
        d->save();
    }
    int64_t last() { return history.latest(1).at(0).number; }
    CXUndone undo(int64_t change) {
        const CXUndone undone = history.undo(change);
        d->save();
        return undone;
    }
    // Everything that a person can see of the database: records with all properties, memberships, choices.
    std::string all() {
        std::ostringstream text;
        for (const CXListing& each : d->listPeople(std::nullopt))
            text << each.uniqueId.str() << " "
                 << Value(d->recordForUniqueId(each.uniqueId)->dictionaryRepresentation()).description() << "\n";
        for (const CXListing& each : d->listGroups(std::nullopt)) {
            const auto group = std::dynamic_pointer_cast<CXGroup>(d->recordForUniqueId(each.uniqueId));
            text << each.uniqueId.str() << " " << Value(group->dictionaryRepresentation()).description();
            std::vector<UniqueId> listed = group->memberUniqueIds(), below = group->subgroupUniqueIds();
            listed.insert(listed.end(), below.begin(), below.end());
            std::sort(listed.begin(), listed.end());
            for (const UniqueId& uid : listed) text << " " << uid.str();
            for (const auto& [person, choices] : group->distributionChoices())
                for (const auto& [property, identifier] : choices)
                    text << " " << person.str() << ":" << property << "=" << identifier;
            text << "\n";
        }
        return text.str();
    }
};

TEST_F(History, TellsWhatWasChangedFromWhatToWhatAndByWhichProgram) {
    d.clock.advance(60);
    ada->setValue("first", kCXNoteProperty);
    d->save();
    ada->setValue("second", kCXNoteProperty);
    d->save();
    const auto changes = history.latest(10, ada->uniqueId());
    ASSERT_EQ(changes.size(), 3U);
    EXPECT_EQ(changes[0].program, "RolvaneManager");
    EXPECT_EQ(changes[1].date, Date(1700000060));
    EXPECT_EQ(changes[2].people, 2U);
    EXPECT_EQ(changes[2].groups, 2U);
    const auto detail = history.details(changes[1].number).at(0);
    EXPECT_EQ(detail.kind, CXDetailKind::changed);
    EXPECT_EQ(history.after(detail)[kCXNoteProperty].string(), "first");
    const auto later = history.details(changes[0].number).at(0);
    EXPECT_EQ(BinaryValue::decode(*later.before).dictionary()[kCXNoteProperty].string(), "first");
    EXPECT_EQ(history.after(later)[kCXNoteProperty].string(), "second");
    EXPECT_EQ(history.latest(10, cleo->uniqueId()).size(), 1U);
}

TEST_F(History, TakesBackEachKindOfChangeToTheSameDatabase) {
    CXMutableMultiValue phones;
    phones.addValue("1", "home");
    phones.addValue("2", "work");
    ada->setValue(phones, kCXPhoneProperty);
    d->save();
    family->setDistributionIdentifier(phones.identifierAtIndex(0), kCXPhoneProperty, ada);
    family->addSubgroup(cousins);
    d->save();
    const UniqueId adas = ada->uniqueId(), families = family->uniqueId();
    const std::vector<std::function<void()>> changes = {
        [&] { ada->setValue("x", kCXNoteProperty); },
        [&] { ada->removeValueForProperty(kCXPhoneProperty); },
        [&] { family->setValue("Kin", kCXGroupNameProperty); },
        [&] { family->removeMember(ada); },
        [&] { family->addMember(cleo); },
        [&] { family->removeSubgroup(cousins); },
        [&] { family->setDistributionIdentifier(phones.identifierAtIndex(1), kCXPhoneProperty, ada); },
        [&] { family->setDistributionIdentifier(std::nullopt, kCXPhoneProperty, ada); },
        [&] { d.addPerson("New"); },
        [&] { d->removeRecord(d->recordForUniqueId(adas)); },
        [&] { d->removeRecord(d->recordForUniqueId(families)); },
        [&] {
            d->removeRecord(d->recordForUniqueId(adas));
            d->removeRecord(d->recordForUniqueId(families));
        },
        [&] { joinPeople(*d, cleo, std::dynamic_pointer_cast<CXPerson>(d->recordForUniqueId(adas))); },
    };
    for (size_t i = 0; i < changes.size(); i++) {
        ada = std::dynamic_pointer_cast<CXPerson>(d->recordForUniqueId(adas));
        family = std::dynamic_pointer_cast<CXGroup>(d->recordForUniqueId(families));
        ASSERT_TRUE(ada && family) << i;
        const std::string before = all();
        changes[i]();
        d->save();
        const int64_t change = last();
        const std::string after = all();
        EXPECT_NE(after, before) << i;
        EXPECT_TRUE(undo(change).left.empty()) << i;
        EXPECT_EQ(all(), before) << i;
        EXPECT_NE(last(), change) << i;
        EXPECT_TRUE(undo(last()).anything()) << "what was taken back is taken back in its turn, " << i;
        EXPECT_EQ(all(), after) << i;
        undo(last());
        EXPECT_EQ(all(), before) << i;
    }
}

TEST_F(History, WhatWasChangedAgainSinceStaysAndIsNamed) {
    ada->setValue("x", kCXNoteProperty);
    ada->setValue("A.", kCXNicknameProperty);
    d->save();
    const int64_t change = last();
    ada->setValue("later", kCXNoteProperty);
    d->save();
    const CXUndone undone = undo(change);
    ASSERT_EQ(undone.left.size(), 1U);
    EXPECT_NE(undone.left[0].find(kCXNoteProperty), std::string::npos);
    EXPECT_EQ(ada->valueForProperty(kCXNoteProperty).string(), "later");
    EXPECT_FALSE(ada->valueForProperty(kCXNicknameProperty));
    const auto made = d.addPerson("New");
    d->save();
    const int64_t addition = last();
    made->setValue("mine", kCXNoteProperty);
    d->save();
    EXPECT_EQ(undo(addition).left.size(), 1U);
    EXPECT_TRUE(d->recordForUniqueId(made->uniqueId()));
}

TEST_F(History, AllSavesOfACommandAreOneChange) {
    history.savesAreOne("import");
    const std::string before = all();
    for (int i = 0; i < 3; i++) {
        d.addPerson("P" + std::to_string(i));
        d->save();
    }
    EXPECT_EQ(history.change(last())->people, 3U);
    EXPECT_EQ(history.change(last())->command, "import");
    EXPECT_EQ(undo(last()).removed, 3U);
    EXPECT_EQ(all(), before);
}

TEST_F(History, ASaveThatFailsLeavesNothingBehind) {
    const int64_t before = last();
    history.savesAreOne("edit");
    {
        Sqlite other(d.path, 0);
        const SqliteTransaction held(other);
        auto options = d.options();
        options.busyTimeoutMilliseconds = 0;
        CXRolvane impatient(options);
        CXHistory(impatient).savesAreOne("edit");
        TestDatabase::addPersonTo(impatient, "Never");
        EXPECT_THROW(impatient.save(), CXException);
    }
    EXPECT_EQ(last(), before);
    ada->setValue("x", kCXNoteProperty);
    d->save();
    EXPECT_EQ(history.change(last())->people, 1U);
}

TEST_F(History, ACopyThatMayNotBeWrittenComesBackAsOnesOwn) {
    d->addRecord(CXSubscription::create(RemoteLocation("http://h/bob/Contacts")));
    const auto bea = d.addSubscribedPerson("Bea", "http://h/bob/Contacts");
    d->save();
    d->removeRecord(bea);
    d->save();
    const CXUndone undone = undo(last());
    EXPECT_EQ(undone.broughtBack, 1U);
    EXPECT_EQ(undone.asOwn, 1U);
    const auto people = d->listPeople(RemoteLocation(""), "Bea");
    ASSERT_EQ(people.size(), 1U);
    EXPECT_FALSE(d->recordForUniqueId(people[0].uniqueId)->valueForProperty(kCXRemoteLocationProperty));
}

TEST_F(History, CopiesThatLeaveWithTheirSubscriptionAreNotKept) {
    const auto subscription = CXSubscription::create(RemoteLocation("http://h/bob/Contacts"));
    d->addRecord(subscription);
    const auto bea = d.addSubscribedPerson("Bea", "http://h/bob/Contacts");
    d->save();
    const int64_t before = last();
    d->removeRecord(subscription);
    d->save();
    EXPECT_FALSE(d->recordForUniqueId(bea->uniqueId()));
    EXPECT_EQ(last(), before);
}

TEST_F(History, IsKeptForThirtyDaysAndWithinItsBound) {
    ada->setValue("old", kCXNoteProperty);
    d->save();
    d.clock.advance(ChangeLog::kSecondsKept - 10);
    cleo->setValue("x", kCXNoteProperty);
    d->save();
    EXPECT_EQ(history.latest(10).size(), 3U);
    d.clock.advance(20);
    cleo->setValue("y", kCXNoteProperty);
    d->save();
    EXPECT_EQ(history.latest(10).size(), 2U);
}

TEST_F(History, TellsWhoWasInAGroupAtAMoment) {
    const auto wasIn = [&](double moment, const UniqueId& who, bool isNow) -> std::optional<bool> {
        const auto until = history.lastUntil(Date(1700000000 + moment));
        return until ? std::optional(history.wasListed(*until, family->uniqueId(), who, isNow)) : std::nullopt;
    };
    const auto change = [&](double seconds, auto edit) {
        d.clock.advance(seconds);
        edit();
        d->save();
    };
    change(10, [&] { family->removeMember(ada); });
    change(10, [&] { family->addMember(cleo); });
    change(10, [&] { family->addMember(ada); });
    const UniqueId adas = ada->uniqueId(), cleos = cleo->uniqueId();
    EXPECT_EQ(wasIn(5, adas, true), true);
    EXPECT_EQ(wasIn(10, adas, true), false);
    EXPECT_EQ(wasIn(30, adas, true), true);
    EXPECT_EQ(wasIn(15, cleos, true), false);
    EXPECT_EQ(wasIn(20, cleos, true), true);
    EXPECT_EQ(wasIn(-1, adas, true), std::nullopt) << "before the log";
    change(10, [&] { d->removeRecord(cleo); });
    EXPECT_EQ(wasIn(35, cleos, false), true) << "by a deletion, too";
    change(-5, [&] { family->removeMember(ada); });
    EXPECT_EQ(wasIn(38, adas, false), std::nullopt) << "before or behind the set-back, nobody knows";
    EXPECT_EQ(wasIn(40, adas, false), std::nullopt);
    change(20, [&] { family->addMember(ada); });
    EXPECT_EQ(wasIn(50, adas, true), false);
}

TEST_F(History, HoldsNoMoreThanItsBoundAndForgetsWholeChanges) {
    Sqlite database(d.path, 1000);
    constexpr int64_t kBound = 10000;
    ChangeLog log(database, kBound);
    const auto note = [&](size_t size, int times) {
        SqliteTransaction transaction(database);
        log.begin("rolvane", d.clock.now());
        const Bytes before(size, 'x');
        for (int i = 0; i < times; i++) log.note(UniqueId("A:CXPerson"), CXDetailKind::changed, {}, &before);
        log.finish();
        transaction.commit();
        log.wasCommitted();
    };
    const auto held = [&] { return database.integer("SELECT coalesce(sum(length(before)), 0) FROM details"); };
    const auto strays = [&] {
        return database.integer("SELECT count(*) FROM details WHERE change NOT IN (SELECT id FROM changes)");
    };
    for (int i = 0; i < 20; i++) {
        note(900, 2);
        EXPECT_LE(held(), kBound) << i;
        EXPECT_EQ(strays(), 0) << i;
    }
    EXPECT_GE(held(), kBound * 7 / 10) << "it is used";
    EXPECT_EQ(held() % 1800, 0) << "whole changes";
    note(kBound + 1, 1);
    EXPECT_EQ(held(), 0) << "one that is larger than all of it";
    note(900, 1);
    EXPECT_EQ(held(), 900);
}

TEST_F(History, OfAContactThatIsForgottenNothingIsLeftInTheFile) {
    ada->setValue("a secret of hers", kCXNoteProperty);
    d->save();
    const UniqueId adas = ada->uniqueId();
    ada->setValue("another", kCXNoteProperty);
    d->save();
    d->removeRecord(ada);
    d->save();
    EXPECT_EQ(history.deletedNamed("Ada"), std::vector<UniqueId>{adas});
    const auto holds = [&](const std::string& path) {
        std::ifstream file(path, std::ios::binary);
        std::ostringstream bytes;
        bytes << file.rdbuf();
        return bytes.str().find("a secret of hers") != std::string::npos;
    };
    EXPECT_TRUE(holds(d.path) || holds(d.path + "-wal"));
    history.forget(adas);
    EXPECT_EQ(history.deletedNamed("Ada"), std::vector<UniqueId>{});
    EXPECT_EQ(history.latest(10, adas).size(), 0U);
    d.database.reset();
    EXPECT_FALSE(holds(d.path) || holds(d.path + "-wal"));
}

TEST(HistoryOfTheFormatBefore, BeginsWithTheFirstOpening) {
    TestDatabase d;
    d.addPerson("Ada", "A:CXPerson");
    d->save();
    d.database.reset();
    Sqlite(d.path, 0).execute("DROP TABLE changes; DROP TABLE details; PRAGMA user_version=7");
    for (int again = 0; again < 2; again++) d.reopen();
    EXPECT_EQ(CXHistory(*d).latest(10).size(), 0U);
    d->recordForUniqueId(UniqueId("A:CXPerson"))->setValue("x", kCXNoteProperty);
    d->save();
    EXPECT_EQ(CXHistory(*d).latest(10).size(), 1U);
    EXPECT_EQ(Sqlite(d.path, 0).integer("PRAGMA user_version"), 9);
}

} // namespace
} // namespace rolvane::test
