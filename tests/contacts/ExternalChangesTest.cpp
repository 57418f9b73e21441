#include "TestDatabase.h"

#include "foundation/Sqlite.h"
#include "support/PrivateBus.h"
#include "support/WaitUntil.h"

#include <filesystem>
#include <map>
#include <set>

namespace rolvane::test {
namespace {

const RemoteLocation kBob{"http://store.example/bob/Contacts"};

// A daemon's view: the database and the notifications that it got.
struct Watching : TestDatabase {
    std::vector<Dictionary> heard;
    ObservationHandle observation =
        center.observe(kCXDatabaseChangedExternallyNotificationPriv, [this](const Notification& n) {
            heard.push_back(n.userInfo);
            if (auto call = during) call(); // it may replace itself
        });
    std::function<void()> during;

    Watching() { database->cursorPosition(); }
    std::unique_ptr<CXRolvane> application() { return open("rolvane"); }
    static std::vector<std::string> list(const Dictionary& info, const char* key) {
        std::vector<std::string> all;
        for (const Value& v : info[key].array()) all.push_back(v.string());
        return all;
    }
};

using Strings = std::vector<std::string>;

TEST(ExternalChanges, OneSaveOfAnotherProgramIsOneNotification) {
    Watching d;
    auto app = d.application();
    CXPersonRef a = TestDatabase::addPersonTo(*app, "A", "A:CXPerson");
    TestDatabase::addPersonTo(*app, "B", "B:CXPerson");
    app->save();
    EXPECT_TRUE(d->hasExternalChanges());
    EXPECT_TRUE(d->deliverExternalChanges());
    ASSERT_EQ(d.heard.size(), 1u);
    EXPECT_EQ(d.list(d.heard[0], kCXInsertedRecords), (Strings{"A:CXPerson", "B:CXPerson"}));
    EXPECT_FALSE(d.heard[0].contains(kCXUpdatedRecords));
    EXPECT_FALSE(d.heard[0].contains(kCXDeletedRecords));
    EXPECT_FALSE(d->deliverExternalChanges()) << "delivered once";
    EXPECT_FALSE(d->hasExternalChanges());
    EXPECT_EQ(d.heard.size(), 1u);
}

TEST(ExternalChanges, TheSenderIsTheProcessThatSaved) {
    Watching d;
    d.database.reset();
    pid_t sender = 0;
    int fds[2];
    ASSERT_EQ(::pipe(fds), 0);
    EXPECT_EQ(inProcess([&] {
                  pid_t self = ::getpid();
                  auto app = d.application();
                  TestDatabase::addPersonTo(*app, "A");
                  app->save();
                  return ::write(fds[1], &self, sizeof self) == sizeof self ? 0 : 1;
              }),
              0);
    ASSERT_EQ(::read(fds[0], &sender, sizeof sender), static_cast<ssize_t>(sizeof sender));
    ::close(fds[0]);
    ::close(fds[1]);
    d.reopen();
    d->deliverExternalChanges();
    ASSERT_EQ(d.heard.size(), 1u);
    EXPECT_EQ(d.heard[0][kCXSenderProcessID].integer(), sender);
}

TEST(ExternalChanges, AProcessNumberThatWasOursBeforeItWasOursIsNotTakenForUs) {
    Watching d;
    auto app = d.application(); // another program, with this very process number
    TestDatabase::addPersonTo(*app, "A");
    app->save();
    d->deliverExternalChanges();
    ASSERT_EQ(d.heard.size(), 1u);
    EXPECT_NE(d.heard[0][kCXSenderProcessID].integer(), ::getpid());
}

TEST(ExternalChanges, WaitingSavesAreJoinedAndNoneIsSplit) {
    Watching d;
    auto app = d.application();
    CXPersonRef a = TestDatabase::addPersonTo(*app, "A", "A:CXPerson");
    app->save();
    a->setValue("A2", kCXFirstNameProperty);
    CXPersonRef b = TestDatabase::addPersonTo(*app, "B", "B:CXPerson");
    app->save();
    app->removeRecord(b);
    app->save();
    d->deliverExternalChanges();
    ASSERT_EQ(d.heard.size(), 1u);
    EXPECT_EQ(d.list(d.heard[0], kCXInsertedRecords), (Strings{"A:CXPerson"}));
    EXPECT_EQ(d.list(d.heard[0], kCXDeletedRecords), (Strings{"B:CXPerson"}));
}

TEST(ExternalChanges, AnUnsubscribeArrivesWhole) {
    Watching d;
    CXSubscriptionRef bob = CXSubscription::create(kBob);
    d->addRecord(bob);
    CXPersonRef theirs = d.addSubscribedPerson("Theirs", kBob.str());
    CXGroupRef group = CXGroup::initWithUniqueId(UniqueId("G:CXSubscribedGroup"));
    group->setValue(TestDatabase::from(kBob.str()), kCXRemoteLocationProperty);
    d->addRecord(group);
    group->addMember(theirs);
    d->save();
    auto app = d.application();
    app->removeRecord(app->findSubscriptionWithRemoteLocation(kBob));
    app->save();
    d->deliverExternalChanges();
    ASSERT_EQ(d.heard.size(), 1u);
    Strings gone = d.list(d.heard[0], kCXDeletedRecords);
    EXPECT_EQ(std::set<std::string>(gone.begin(), gone.end()),
              (std::set<std::string>{bob->uniqueId().str(), theirs->uniqueId().str(), "G:CXSubscribedGroup"}))
        << "and no all-contacts group, whose normal form would name the owner's";
    EXPECT_FALSE(d.heard[0].contains(kCXUpdatedRecords));
    EXPECT_FALSE(d.heard[0].contains(kCXInsertedRecords));
}

TEST(ExternalChanges, WhatAnEarlierRunOfTheSameProgramWroteNeverComesBack) {
    Watching d;
    d.database.reset();
    EXPECT_EQ(inProcess([&] {
                  auto daemon = d.open("RolvaneManager");
                  TestDatabase::addPersonTo(*daemon, "A");
                  daemon->save();
                  return 0;
              }),
              0);
    d.reopen();
    EXPECT_EQ(d->countPeople(std::nullopt), 1u);
    EXPECT_FALSE(d->deliverExternalChanges());
    EXPECT_TRUE(d.heard.empty());
}

TEST(ExternalChanges, TheCursorOutlivesTheProcess) {
    Watching d;
    d.database.reset();
    auto app = d.application();
    TestDatabase::addPersonTo(*app, "A", "A:CXPerson");
    app->save();
    d.database = d.open();
    EXPECT_TRUE(d->deliverExternalChanges());
    d.reopen();
    EXPECT_FALSE(d->deliverExternalChanges());
    EXPECT_EQ(d.heard.size(), 1u);
}

TEST(ExternalChanges, AnObserverThatFailsGetsTheChangesAgain) {
    Watching d;
    auto app = d.application();
    TestDatabase::addPersonTo(*app, "A");
    app->save();
    d.during = [] { throw CXException(kCXDatabaseException, "in the way"); };
    EXPECT_THROW(d->deliverExternalChanges(), CXException);
    d.during = nullptr;
    EXPECT_TRUE(d->deliverExternalChanges());
    ASSERT_EQ(d.heard.size(), 2u);
    EXPECT_EQ(d.heard[0], d.heard[1]);
}

TEST(ExternalChanges, ACrashWhileTheyAreHandledDeliversThemAgain) {
    Watching d;
    auto app = d.application();
    TestDatabase::addPersonTo(*app, "A", "A:CXPerson");
    app->save();
    app.reset();
    d.database.reset();
    EXPECT_EQ(inProcess([&] {
                  d.during = [] { ::_exit(7); };
                  d.open()->deliverExternalChanges();
                  return 0;
              }),
              7);
    d.reopen();
    EXPECT_TRUE(d->deliverExternalChanges());
    ASSERT_EQ(d.heard.size(), 1u);
    EXPECT_EQ(d.list(d.heard[0], kCXInsertedRecords), (Strings{"A:CXPerson"}));
}

TEST(ExternalChanges, AnEditSavedWhileAPassRunsComesInTheNextDelivery) {
    Watching d;
    auto app = d.application();
    CXPersonRef a = TestDatabase::addPersonTo(*app, "A", "A:CXPerson");
    app->save();
    d.during = [&] {
        d.during = nullptr;
        EXPECT_FALSE(d->deliverExternalChanges()) << "not nested";
        a->setValue("A2", kCXFirstNameProperty);
        app->save();
        d->save();
    };
    EXPECT_TRUE(d->deliverExternalChanges());
    EXPECT_TRUE(d->deliverExternalChanges());
    EXPECT_FALSE(d->deliverExternalChanges());
    ASSERT_EQ(d.heard.size(), 2u);
    EXPECT_EQ(d.list(d.heard[1], kCXUpdatedRecords), (Strings{"A:CXPerson"}));
}

TEST(ExternalChanges, WhatAFullScanCapturedIsNotDeliveredOnceMore) {
    Watching d;
    Date lastSync = d.clock.now();
    d.clock.advance(1);
    auto app = d.application();
    TestDatabase::addPersonTo(*app, "A");
    app->save();
    int64_t position = d->journalPosition();
    TestDatabase::addPersonTo(*app, "Late");
    app->save();
    d->advanceCursorTo(position, lastSync);
    EXPECT_TRUE(d->deliverExternalChanges());
    ASSERT_EQ(d.heard.size(), 1u);
    EXPECT_EQ(d.list(d.heard[0], kCXInsertedRecords).size(), 1u) << "only what came during the scan";
}

TEST(ExternalChanges, WhatAFullScanCouldNotSeeIsDeliveredAllTheSame) {
    Watching d;
    auto app = d.application();
    TestDatabase::addPersonTo(*app, "DuringTheLastPass", "A:CXPerson");
    app->save();
    d.clock.advance(1);
    Date lastSync = d.clock.now(); // taken at the end of that pass
    d.clock.advance(1);
    TestDatabase::addPersonTo(*app, "After", "B:CXPerson");
    app->save();
    std::vector<std::string> scanned;
    d->forEachPersonModifiedSince(lastSync, kCXPersonTable,
                                  [&](const CXRow& row) { scanned.push_back(row.uniqueId.str()); });
    EXPECT_EQ(scanned, (Strings{"B:CXPerson"}));
    d->advanceCursorTo(d->journalPosition(), lastSync);
    EXPECT_TRUE(d->deliverExternalChanges());
    ASSERT_EQ(d.heard.size(), 1u);
    EXPECT_EQ(d.list(d.heard[0], kCXInsertedRecords), (Strings{"A:CXPerson"})) << "the scan has taken the other one";
    EXPECT_FALSE(d.heard[0].contains(kCXUpdatedRecords));
}

TEST(ExternalChanges, OfSeveralScansInARowNoneIsForgotten) {
    Watching d;
    auto app = d.application();
    std::vector<Date> lastSync;
    for (const char* uid : {"During:CXPerson", "First:CXPerson", "Second:CXPerson"}) {
        TestDatabase::addPersonTo(*app, uid, uid);
        app->save();
        if (!lastSync.empty()) d->advanceCursorTo(d->journalPosition(), lastSync.back()); // by a scan since then
        d.clock.advance(1);
        lastSync.push_back(d.clock.now());
        d.clock.advance(1);
    }
    EXPECT_TRUE(d->deliverExternalChanges());
    ASSERT_EQ(d.heard.size(), 1u);
    EXPECT_EQ(d.list(d.heard[0], kCXInsertedRecords), (Strings{"During:CXPerson"})) << "no scan has taken this one";
    EXPECT_FALSE(d->deliverExternalChanges());
}

TEST(ExternalChanges, TheCursorNeverMovesBackwards) {
    Watching d;
    auto app = d.application();
    TestDatabase::addPersonTo(*app, "A");
    app->save();
    d->deliverExternalChanges();
    int64_t at = d->cursorPosition();
    d->advanceCursorTo(0, Date::distantPast());
    EXPECT_EQ(d->cursorPosition(), at);
    EXPECT_FALSE(d->deliverExternalChanges());
}

TEST(ExternalChanges, APropertyOfAGroupNamesTheGroupAndItsListsNameItsContents) {
    Watching d;
    CXGroupRef friends = d.addGroup("Friends", "G:CXGroup");
    CXPersonRef a = d.addPerson("A", "A:CXPerson");
    d->save();
    auto app = d.application();
    auto there = std::dynamic_pointer_cast<CXGroup>(app->recordForUniqueId(friends->uniqueId()));
    auto person = std::dynamic_pointer_cast<CXPerson>(app->recordForUniqueId(a->uniqueId()));
    there->setValue("Pals", kCXGroupNameProperty);
    app->save();
    d->deliverExternalChanges();
    there->addMember(person);
    app->save();
    d->deliverExternalChanges();
    there->setDistributionIdentifier("x", kCXEmailProperty, person);
    app->save();
    d->deliverExternalChanges();
    there->setValue("Chums", kCXGroupNameProperty);
    there->removeMember(person);
    app->save();
    d->deliverExternalChanges();
    ASSERT_EQ(d.heard.size(), 4u);
    EXPECT_EQ(d.list(d.heard[0], kCXUpdatedRecords), (Strings{"G:CXGroup"}));
    EXPECT_EQ(d.list(d.heard[1], kCXUpdatedRecords), (Strings{"G:CXGroupContents"}));
    EXPECT_EQ(d.list(d.heard[2], kCXUpdatedRecords), (Strings{"G:CXGroupContents"}));
    EXPECT_EQ(d.list(d.heard[3], kCXUpdatedRecords), (Strings{"G:CXGroup"})) << "once is enough";
    auto contents = std::dynamic_pointer_cast<CXGroupContents>(d->recordForUniqueId(UniqueId("G:CXGroupContents")));
    ASSERT_TRUE(contents);
    EXPECT_EQ(d->recordForUniqueId(contents->nts_GroupUID()), friends);
    d->removeRecord(friends);
    EXPECT_EQ(d->recordForUniqueId(UniqueId("G:CXGroupContents")), nullptr);
}

TEST(ExternalChanges, ASubscribedGroupsContentsNameTheSubscribedGroup) {
    Watching d;
    auto app = d.application();
    CXGroupRef group = CXGroup::initWithUniqueId(UniqueId("G:CXSubscribedGroup"));
    app->addRecord(group);
    CXPersonRef a = TestDatabase::addPersonTo(*app, "A");
    app->save();
    d->deliverExternalChanges();
    group->addMember(a);
    app->save();
    d->deliverExternalChanges();
    Strings updated = d.list(d.heard.back(), kCXUpdatedRecords);
    ASSERT_EQ(updated.size(), 1u);
    auto contents = std::dynamic_pointer_cast<CXGroupContents>(d->recordForUniqueId(UniqueId(updated[0])));
    ASSERT_TRUE(contents);
    EXPECT_EQ(contents->nts_GroupUID().str(), "G:CXSubscribedGroup");
}

TEST(ExternalChanges, APropertyOfAllContactsComesAsInfo) {
    Watching d;
    auto app = d.application();
    app->allGroup()->setValue("Everybody", kCXGroupNameProperty);
    app->save();
    d->deliverExternalChanges();
    ASSERT_EQ(d.heard.size(), 1u);
    Strings updated = d.list(d.heard[0], kCXUpdatedRecords);
    ASSERT_EQ(updated.size(), 1u);
    EXPECT_TRUE(std::dynamic_pointer_cast<CXInfo>(d->recordForUniqueId(UniqueId(updated[0])))) << updated[0];
    EXPECT_EQ(d->allGroup()->name(), "Everybody");
}

TEST(ExternalChanges, ManyOwnSavesDoNotHideAForeignOneAndAreForgottenInTime) {
    Watching d;
    for (int i = 0; i < 1100; i++) d.addPerson("own");
    d->save();
    auto app = d.application();
    TestDatabase::addPersonTo(*app, "A", "A:CXPerson");
    app->save();
    EXPECT_TRUE(d->deliverExternalChanges());
    EXPECT_EQ(d.list(d.heard.at(0), kCXInsertedRecords), (Strings{"A:CXPerson"}));
    for (int i = 0; i < 1100; i++) d.addPerson("own");
    d->save();
    EXPECT_FALSE(d->deliverExternalChanges());
    d.addPerson("last");
    d->save();
    EXPECT_LE(d->journalEntries(0, 10000).size(), 1001u) << "what every cursor has passed is pruned, but for the last";
}

TEST(ExternalChanges, AFileWatchWakesARunLoopWithoutAnyBus) {
    Watching d;
    auto options = d.options();
    options.runLoop = &RunLoop::current();
    d.database = std::make_unique<CXRolvane>(options);
    RunLoop::current().runOnce(0);
    EXPECT_EQ(inProcess([&] {
                  auto app = d.application();
                  TestDatabase::addPersonTo(*app, "A", "A:CXPerson");
                  app->save();
                  return 0;
              }),
              0);
    EXPECT_TRUE(waitUntil([&] { return !d.heard.empty(); }, "the other process's save"));
    ASSERT_EQ(d.heard.size(), 1u);
    EXPECT_EQ(d.list(d.heard[0], kCXInsertedRecords), (Strings{"A:CXPerson"}));
}

// A backup, say. Whoever goes on with the former file lives in the past.
TEST(ExternalChanges, AnotherFileInTheDatabasesPlaceIsNoticedAtOnce) {
    Watching d;
    const std::string other = d.directory / "other.db";
    Sqlite(other, 0).execute("CREATE TABLE t(x)");
    auto options = d.options();
    options.runLoop = &RunLoop::current();
    d.database = std::make_unique<CXRolvane>(options);
    for (int i = 0; i < 3; ++i) RunLoop::current().runOnce(0);
    std::filesystem::rename(other, d.path);
    std::string told;
    try {
        waitUntil([] { return false; }, "word of the replacement", 10);
    } catch (const CXException& e) {
        told = e.reason();
    }
    EXPECT_NE(told.find("replaced"), std::string::npos) << told;
}

TEST(ExternalChanges, WhatWaitedWhileNobodyWatchedIsDeliveredInTheFirstTurns) {
    Watching d;
    d.database.reset();
    auto app = d.application();
    TestDatabase::addPersonTo(*app, "A");
    app->save();
    auto options = d.options();
    options.runLoop = &RunLoop::current();
    d.database = std::make_unique<CXRolvane>(options);
    EXPECT_TRUE(waitUntil([&] { return d.heard.size() == 1; }, "the waiting save"));
}

TEST(ExternalChanges, ABusSignalWakesARunLoop) {
    Watching d;
    PrivateBus bus;
    auto hearing = makeBusNotifications(RunLoop::current(), bus.address());
    auto speaking = makeBusNotifications(RunLoop::current(), bus.address());
    std::vector<Notification> signals;
    auto listening = hearing->observe(
        kCXDatabaseChangedDistributedNotification, [&](const Notification& n) { signals.push_back(n); }, true);
    auto options = d.options("rolvane");
    options.distributed = speaking.get();
    CXRolvane app(options);
    TestDatabase::addPersonTo(app, "A");
    app.save();
    EXPECT_TRUE(waitUntil([&] { return !signals.empty(); }, "the signal"));
    EXPECT_EQ(signals.at(0).userInfo[kCXDatabasePathKey].string(), app.path());
    EXPECT_EQ(signals.at(0).userInfo[kCXDatabaseIdentityKey].string(), app.databaseIdentity());
}

TEST(ExternalChanges, ThreeHundredEditsOfAnotherProcessAreDeliveredOnceEach) {
    Watching d;
    auto options = d.options();
    options.runLoop = &RunLoop::current();
    d.database.reset();
    pid_t child = ::fork();
    if (child == 0) {
        auto app = d.application();
        for (int i = 0; i < 300; i++) {
            TestDatabase::addPersonTo(*app, "P", std::to_string(i) + ":CXPerson");
            app->save();
        }
        ::_exit(0);
    }
    d.database = std::make_unique<CXRolvane>(options);
    std::map<std::string, int> times;
    d.during = [&] {
        for (const std::string& uid : d.list(d.heard.back(), kCXInsertedRecords)) times[uid]++;
        for (const std::string& uid : d.list(d.heard.back(), kCXUpdatedRecords)) times[uid]++;
        d->setShareCount(d->shareCount() + 1); // a pass writes too
        d->save();
    };
    EXPECT_TRUE(waitUntil([&] { return times.size() == 300; }, "300 edits", 60));
    int status = 0;
    ::waitpid(child, &status, 0);
    while (d->deliverExternalChanges()) {
    }
    EXPECT_EQ(times.size(), 300u);
    for (const auto& [uid, count] : times) EXPECT_EQ(count, 1) << uid;
}

TEST(ExternalChanges, UnsavedWorkLocksNobodyOut) {
    Watching d;
    CXPersonRef mine = d.addPerson("Mine");
    d->forEachPersonModifiedSince(Date::distantPast(), kCXPersonTable, [](const CXRow&) {});
    auto options = d.options("rolvane");
    options.busyTimeoutMilliseconds = 0;
    CXRolvane app(options);
    TestDatabase::addPersonTo(app, "Theirs");
    EXPECT_NO_THROW(app.save());
    EXPECT_EQ(app.countPeople(std::nullopt), 1u) << "unsaved changes are nobody else's";
    d->save();
    EXPECT_EQ(app.countPeople(std::nullopt), 2u);
    EXPECT_EQ(mine->valueForProperty(kCXFirstNameProperty).string(), "Mine");
}

} // namespace
} // namespace rolvane::test
