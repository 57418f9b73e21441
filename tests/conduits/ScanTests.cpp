#include "CaptureWorld.h"
#include "contacts/database/DaemonMemory.h"

#include <algorithm>
#include <set>

using namespace rolvane;
using namespace rolvane::test;

namespace {

class Scan : public CaptureWorld {
public:
    std::string uid(const CXRecordRef& record) { return record->sharingUniqueId().str(); }
    // One pass in which everything that was captured is applied: every group and person is then known.
    void pass() {
        conduit->open();
        conduit->changeRecords();
        knows(kSelf, database.allGroup());
        for (const auto& record : database.recordsMatchingSearchElement(CXGroup::searchElementForProperty(
                 kCXModificationDateProperty, "", "", Date::distantPast(), kCXGreaterThan)))
            knows(kSelf, std::dynamic_pointer_cast<CXGroup>(record));
        clock.advance(1);
        conduit->close();
        clock.advance(1);
    }
    Texts scan() {
        conduit->open();
        return lines(conduit->changeRecords());
    }
};

} // namespace

TEST_F(Scan, TheFirstOneComparesEveryGroupAndPersonAndThenTheAllContactsGroup) {
    publishAll();
    const auto ada = person("Ada");
    const auto friends = group("F", {ada});
    save();
    const std::string a = uid(ada), f = uid(friends);
    const Texts group{"2 <self> - " + f + " 4",         "6 <self> " + f + " AllCXGroup 4", "1 <self> " + a + " - 4",
                      "9 <self> " + a + " " + f + " 4", "5 <self> " + a + " " + f + " 4",  "4 <self> - " + f + " 4",
                      "9 <self> " + a + " " + f + " 4"};
    Texts expected = group;
    expected.insert(expected.end(), {"1 <self> " + a + " - 4", "9 <self> " + a + " " + f + " 4"}); // the person itself
    expected.insert(expected.end(), {"2 <self> - AllCXGroup 4", "1 <self> " + a + " - 4",
                                     "9 <self> " + a + " " + f + " 4", "5 <self> " + a + " AllCXGroup 4"});
    expected.insert(expected.end(), group.begin(), group.end()); // as a new subgroup of the all-contacts group
    expected.push_back("6 <self> " + f + " AllCXGroup 4");
    EXPECT_EQ(scan(), expected);
    EXPECT_EQ(engine.takeCalls(), Texts{"checkCXShareCount"});
}

TEST_F(Scan, ReadsTheDistantPastWhenNoDateIsStored) {
    conduit->open();
    EXPECT_EQ(conduit->lastSyncDate(), Date::distantPast());
}

TEST_F(Scan, SaysNothingAboutWhatWasThereAtTheLastSync) {
    publishAll();
    group("F", {person("Ada")});
    save();
    pass();
    EXPECT_EQ(scan(), Texts{});
}

TEST_F(Scan, AScannedPersonCountsAsUpdatedNeverAsInserted) {
    publishAll();
    save();
    pass();
    const auto ada = person("Ada");
    save();
    const Texts found = scan();
    ASSERT_FALSE(found.empty());
    EXPECT_EQ(found[0], "1 <self> " + uid(ada) + " - 4");
    EXPECT_EQ(std::count(found.begin(), found.end(), "5 <self> " + uid(ada) + " AllCXGroup 4"), 1)
        << "the entry comes from the comparison of the all-contacts group alone";
}

TEST_F(Scan, ComparesTheAllContactsGroupsWhateverTheDates) {
    publishAll();
    const auto ada = person("Ada");
    subscribe();
    const auto carol = subscribedPerson("Carol", "C");
    database.allGroupForRemoteLocation(kBobsLocation)
        ->setValue(oneLocation(kBobsLocation, kCXSubscribeLabel), kCXRemoteLocationProperty);
    save();
    pass();
    knows(UserName("bob"), database.allGroupForRemoteLocation(kBobsLocation));
    EXPECT_EQ(scan(), Texts{});
    engine.priorState("CXDCX").remove("<self>");
    engine.priorState("CXDCX").remove("bob");
    EXPECT_EQ(scan(), (Texts{"2 bob - AllCXGroup 4", "1 bob C:CXPerson - 4", "5 bob C:CXPerson AllCXGroup 4",
                             "2 <self> - AllCXGroup 4", "1 <self> " + uid(ada) + " - 4",
                             "5 <self> " + uid(ada) + " AllCXGroup 4"}));
}

TEST_F(Scan, APersonCapturedSeveralTimesSharesOnePayload) {
    publishAll();
    const auto ada = person("Ada");
    group("F", {ada});
    group("G", {ada});
    save();
    conduit->open();
    std::set<const Bytes*> payloads;
    size_t updates = 0;
    for (const auto& record : conduit->changeRecords())
        if (record->type() == CXDUpdateRecord) {
            ++updates;
            payloads.insert(record->encodedPayload().get());
        }
    EXPECT_GE(updates, 4u);
    EXPECT_EQ(payloads.size(), 1u);
    EXPECT_FALSE(payloads.contains(nullptr));
}

TEST_F(Scan, ClosingSavesTheDatabaseAndMovesTheLastSyncDateToTheEndOfThePass) {
    conduit->open();
    person("Ada");
    EXPECT_TRUE(database.hasUnsavedChanges());
    clock.advance(10);
    conduit->close();
    EXPECT_FALSE(database.hasUnsavedChanges());
    EXPECT_EQ(conduit->lastSyncDate(), clock.now());
    EXPECT_EQ(Preferences(directory / "preferences.db", daemonMemory(directory / "contacts.db"))
                  .get(kDaemonDomain, "CXDCXConduitLastSyncDate")
                  .date(),
              clock.now())
        << "the date is synchronised";
}

// Each group lists both of the next layer: there are 2^16 ways to the last one.
TEST_F(Scan, GroupsThatContainOneAnotherOnVeryManyWaysAreCapturedInTime) {
    constexpr size_t kLayers = 16;
    publishAll();
    std::vector<CXGroupRef> layer{group("a"), group("b")}, all = layer;
    for (size_t i = 1; i < kLayers; ++i) {
        const std::vector<CXGroupRef> next{group("c"), group("d")};
        for (const CXGroupRef& above : layer)
            for (const CXGroupRef& below : next) above->addSubgroup(below);
        all.insert(all.end(), next.begin(), next.end());
        layer = next;
    }
    save();
    conduit->open();
    const CXDChangeRecords records = conduit->changeRecords();
    EXPECT_LT(records.size(), 20000u);
    std::set<UniqueId> made;
    for (const CXDChangeRecordPtr& record : records)
        if (record->type() == CXDCreateStructureForGroup) made.insert(*record->group());
    for (const CXGroupRef& each : all) EXPECT_TRUE(made.contains(each->sharingUniqueId()));
}

TEST_F(Scan, ClosingForgetsRevokedUsers) {
    engine.priorState("CXDCX").set("bob", Dictionary());
    engine.revoked = {kBobsLocation};
    conduit->open();
    conduit->close();
    EXPECT_TRUE(engine.priorState("CXDCX").empty());
}

// -- the journal

namespace {

class Journal : public Scan {
public:
    Journal() {
        delivered = center.observe(kCXDatabaseChangedExternallyNotificationPriv, [this](const Notification& n) {
            for (const char* key : {kCXInsertedRecords, kCXUpdatedRecords})
                for (const Value& identifier : n.userInfo[key].array()) seen.push_back(identifier.string());
        });
    }
    // The contact application, another program on the same file.
    std::unique_ptr<CXRolvane> application() {
        return std::make_unique<CXRolvane>(CXRolvane::Options{.path = directory / "contacts.db",
                                                              .program = "rolvane",
                                                              .clock = &clock,
                                                              .center = &applicationsCenter,
                                                              .distributed = nullptr,
                                                              .runLoop = nullptr});
    }
    CXPersonRef edit(CXRolvane& theirs, const char* name) {
        auto made = CXPerson::create();
        made->setValue(Value(name), kCXFirstNameProperty);
        theirs.addRecord(made);
        theirs.save();
        return made;
    }
    NotificationCenter applicationsCenter;
    ObservationHandle delivered;
    Texts seen;
};

} // namespace

TEST_F(Journal, WhatAScanCapturedIsNotDeliveredOnceMore) {
    publishAll();
    save();
    database.deliverExternalChanges();
    pass();
    const auto theirs = application();
    clock.advance(1);
    const auto ada = edit(*theirs, "Ada");
    clock.advance(1);
    ASSERT_TRUE(database.hasExternalChanges());
    conduit->open();
    const Texts found = lines(conduit->changeRecords());
    EXPECT_EQ(found.empty() ? "" : found[0], "1 <self> " + uid(ada) + " - 4");
    clock.advance(1);
    conduit->close();
    EXPECT_FALSE(database.hasExternalChanges());
    EXPECT_FALSE(database.deliverExternalChanges());
    EXPECT_EQ(seen, Texts{});
}

TEST_F(Journal, AnEditDuringThePassIsDeliveredAfterIt) {
    publishAll();
    save();
    database.deliverExternalChanges();
    const auto theirs = application();
    conduit->open();
    conduit->changeRecords();
    clock.advance(1);
    const auto ada = edit(*theirs, "Ada");
    clock.advance(1);
    conduit->close();
    EXPECT_GT(*conduit->lastSyncDate(), ada->valueForProperty(kCXModificationDateProperty).date())
        << "the next scan alone would not find the edit";
    ASSERT_TRUE(database.deliverExternalChanges());
    EXPECT_EQ(seen, Texts{ada->uniqueId().str()});
    EXPECT_EQ(lines(engine.applied).at(0), "1 <self> " + uid(ada) + " - 4");
}

// In the middle of the scan: after its first comparison and before it reads any person.
TEST_F(Journal, AnEditSavedWhileAScanReadsIsDeliveredOnceAndNotScanned) {
    publishAll();
    const auto ben = person("Ben");
    const auto friends = group("Friends", {ben});
    save();
    database.deliverExternalChanges();
    const auto theirs = application();
    const auto theirBen = std::dynamic_pointer_cast<CXPerson>(theirs->recordForUniqueId(ben->uniqueId()));
    CXPersonRef ada;
    engine.whenAskedForAUser = [&] {
        theirBen->setValue(Value("Benjamin"), kCXFirstNameProperty);
        std::dynamic_pointer_cast<CXGroup>(theirs->recordForUniqueId(friends->uniqueId()))->removeMember(theirBen);
        ada = edit(*theirs, "Ada");
    };
    conduit->open();
    std::string scanned;
    for (const CXDChangeRecordPtr& record : conduit->changeRecords())
        scanned += record->description() + Value(record->payload()).description() + "\n";
    ASSERT_TRUE(ada) << "nothing was saved during the scan";
    EXPECT_EQ(scanned.find("Benjamin"), std::string::npos) << scanned;
    EXPECT_EQ(scanned.find(uid(ada)), std::string::npos) << scanned;
    EXPECT_NE(scanned.find("\"Ben\""), std::string::npos) << "as it was";
    clock.advance(1);
    conduit->close();
    ASSERT_TRUE(database.deliverExternalChanges());
    EXPECT_EQ(std::count(seen.begin(), seen.end(), ada->uniqueId().str()), 1);
    EXPECT_EQ(std::count(seen.begin(), seen.end(), ben->uniqueId().str()), 1);
    EXPECT_FALSE(database.deliverExternalChanges());
    EXPECT_EQ(ben->valueForProperty(kCXFirstNameProperty), Value("Benjamin")) << "the moment is over";
}

TEST_F(Journal, AnEditBehindTheScansMarkIsDeliveredAfterThePass) {
    publishAll();
    save();
    database.deliverExternalChanges();
    const auto theirs = application();
    conduit->open();
    conduit->changeRecords();
    const auto ada = edit(*theirs, "Ada"); // at the same instant by the clock
    conduit->close();
    ASSERT_TRUE(database.deliverExternalChanges());
    EXPECT_EQ(seen, Texts{ada->uniqueId().str()});
}

TEST_F(Journal, AnEditSavedWhileTheLastPassEndedIsDeliveredAlthoughTheNextScanCannotSeeIt) {
    publishAll();
    save();
    database.deliverExternalChanges();
    const auto theirs = application();
    pass();
    // Its save began before the pass ended: it is dated at the very last-sync date.
    clock.set(*conduit->lastSyncDate());
    const auto ada = edit(*theirs, "Ada");
    clock.advance(5);
    engine.priorState("CXDCX").dictionaryFor("<self>").remove("AllCXGroup");
    pass();
    ASSERT_TRUE(database.deliverExternalChanges());
    EXPECT_EQ(seen, Texts{ada->uniqueId().str()});
}

TEST_F(Journal, APassWithoutAScanLeavesTheJournalToTheNotification) {
    publishAll();
    save();
    database.deliverExternalChanges();
    const auto theirs = application();
    clock.advance(1);
    const auto ada = edit(*theirs, "Ada");
    clock.advance(1);
    conduit->open();
    conduit->close();
    ASSERT_TRUE(database.deliverExternalChanges());
    EXPECT_EQ(seen, Texts{ada->uniqueId().str()});
}

TEST_F(Journal, AScanOfAPassThatNeverEndedCountsForNothing) {
    publishAll();
    save();
    database.deliverExternalChanges();
    const auto theirs = application();
    clock.advance(1);
    const auto ada = edit(*theirs, "Ada");
    clock.advance(1);
    conduit->open();
    conduit->changeRecords();
    conduit->open(); // the next pass, without a scan
    conduit->close();
    ASSERT_TRUE(database.deliverExternalChanges());
    EXPECT_EQ(seen, Texts{ada->uniqueId().str()});
}
