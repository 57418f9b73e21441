// What the daemon wrote itself never comes back as somebody's edit.

#include "ApplyWorld.h"

using namespace rolvane;
using namespace rolvane::test;

namespace {

// The daemon's database object and, beside it, the contact application's. The conduit knows the first by its program.
class OwnWrites : public ApplyWorld {
public:
    OwnWrites() {
        publishAll();
        subscribeLabel();
        save();
        conduit = daemonsConduit();
    }
    std::unique_ptr<CXDCXConduit> daemonsConduit() {
        return std::make_unique<CXDCXConduit>(engine,
                                              CXDCXConduit::Collaborators{database, preferences, clock, center});
    }
    // Bob's all-contacts group leads to Bob, as in every subscribed database.
    void subscribeLabel() {
        database.allGroupForRemoteLocation(kBobsLocation)
            ->setValue(oneLocation(kBobsLocation, kCXSubscribeLabel), kCXRemoteLocationProperty);
    }
    // As the engine drives it, records applied between; the state that the engine would have folded is taken from the
    // database. Gives what the scan captured.
    CXDChangeRecords pass(
        const std::function<void()>& applying = [] {}, bool crash = false) {
        conduit->open();
        const CXDChangeRecords captured = conduit->changeRecords();
        applying();
        clock.advance(1);
        database.save();
        if (crash) {
            conduit = daemonsConduit();
            return captured;
        }
        foldEverything();
        conduit->close();
        clock.advance(1);
        return captured;
    }
    void foldEverything() {
        knows(kSelf, database.allGroup());
        engine.priorState("CXDCX")
            .dictionaryFor(kSelf.str())
            .dictionaryFor("AllCXGroup")
            .set(kCXReadWriteSharingACLProperty, Array{"carol"});
        knows(UserName("bob"), database.allGroupForRemoteLocation(kBobsLocation));
        for (const auto& listing : database.listGroups(std::nullopt)) {
            const auto group = groupAt(listing.uniqueId.str().c_str());
            knows(group->isSubscribed() ? UserName("bob") : kSelf, group);
        }
    }
    void arrive(const char* uuid, const char* name) {
        const std::string uid = std::string(uuid) + ":CXSubscribedPerson";
        apply(CXDUpdateRecord, "bob", uid.c_str(), nullptr, card(name));
        apply(CXDAddRecordToGroup, "bob", uid.c_str(), "AllCXGroup");
    }
    void everythingArrives() {
        arrive("B", "Bert");
        arrive("C", "Cora");
        apply(CXDUpdateRecord, "<self>", "A:CXPerson", nullptr, card("Ada"));
        apply(CXDCreateStructureForGroup, "bob", nullptr, "G:CXSubscribedGroup", groupPayload("Friends"));
        apply(CXDChangeGroupName, "bob", nullptr, "G:CXGroup", "Friends");
        apply(CXDAddRecordToGroup, "bob", "B:CXSubscribedPerson", "G:CXSubscribedGroup");
        apply(CXDUpdateDistributionList, "bob", "B:CXPerson", "G:CXGroup", Dictionary{{kCXEmailProperty, "x"}});
        apply(CXDChangeGroupReadWriteACL, "bob", nullptr, "AllCXGroup", Dictionary{{"additions", Array{"<self>"}}});
        conduit->saveACLs();
    }
    static bool updatesBobs(const CXDChangeRecords& records) {
        return std::any_of(records.begin(), records.end(), [](const auto& record) {
            return record->type() == CXDUpdateRecord && record->user() == UserName("bob");
        });
    }
    CXRolvane application{CXRolvane::Options{.path = directory / "contacts.db",
                                             .program = "rolvane",
                                             .clock = &clock,
                                             .center = &center,
                                             .distributed = nullptr,
                                             .runLoop = nullptr}};
};

} // namespace

TEST_F(OwnWrites, ASecondPassAfterEverythingArrivedMakesNoRecords) {
    pass([&] { everythingArrives(); });
    EXPECT_EQ(lines(pass()), Texts{});
    EXPECT_EQ(lines(pass()), Texts{});
}

TEST_F(OwnWrites, ASecondPassAfterEverythingLeftMakesNoRecords) {
    pass([&] { everythingArrives(); });
    pass([&] {
        apply(CXDRemoveRecordFromGroup, "bob", "B:CXPerson", "G:CXGroup");
        apply(CXDRemoveRecordFromGroup, "bob", "C:CXPerson", "AllCXGroup");
        apply(CXDDeleteRecord, "<self>", "A:CXPerson", nullptr);
        apply(CXDDeleteGroup, "bob", nullptr, "G:CXGroup");
        apply(CXDChangeGroupReadWriteACL, "bob", nullptr, "AllCXGroup", Dictionary{{"deletions", Array{"<self>"}}});
        conduit->saveACLs();
    });
    EXPECT_EQ(lines(pass()), Texts{});
}

TEST_F(OwnWrites, TheJournalDeliversNoneOfThem) {
    database.deliverExternalChanges();
    pass([&] { everythingArrives(); });
    EXPECT_FALSE(database.hasExternalChanges());
    EXPECT_FALSE(database.deliverExternalChanges());
}

TEST_F(OwnWrites, APassThatWasCutOffAfterItsSaveCarriesNoCopyBackToItsPublisher) {
    pass();
    pass([&] { everythingArrives(); }, /*crash*/ true);
    const CXDChangeRecords captured = pass();
    EXPECT_FALSE(updatesBobs(captured)) << ::testing::PrintToString(lines(captured));
    EXPECT_EQ(lines(pass()), Texts{});
}

TEST_F(OwnWrites, AfterTheMemoryIsLostNoCopyIsCarriedBackToItsPublisher) {
    pass([&] { everythingArrives(); });
    for (int i = 0; i < 30; i++) arrive(("M" + std::to_string(i)).c_str(), "Many"); // they are read together
    pass();
    engine.data = Dictionary();
    preferences.set(kDaemonDomain, CXDCXConduit::kLastSyncDateKey, Value());
    const CXDChangeRecords captured = pass();
    EXPECT_FALSE(updatesBobs(captured)) << ::testing::PrintToString(lines(captured));
}

TEST_F(OwnWrites, TheOwnersPeopleWhomTheDaemonWroteArePublishedWhereTheyAreNotYet) {
    pass([&] { everythingArrives(); });
    engine.data = Dictionary();
    const CXDChangeRecords captured = pass();
    EXPECT_TRUE(std::any_of(captured.begin(), captured.end(), [](const auto& r) {
        return r->type() == CXDUpdateRecord && r->person() == UniqueId("A:CXPerson") && r->user() == kSelf;
    })) << ::testing::PrintToString(lines(captured));
}

TEST_F(OwnWrites, AnEditOfACopyByAPersonIsStillCapturedWhetherByScanOrByJournal) {
    pass([&] { everythingArrives(); });
    application.recordForUniqueId(UniqueId("B:CXSubscribedPerson"))->setValue(Value("Bertie"), kCXFirstNameProperty);
    application.save();
    clock.advance(1);
    const Texts expected{"1 bob B:CXPerson - 4", "9 bob B:CXPerson G:CXGroup 4"};
    EXPECT_EQ(lines(after(changed({}, {UniqueId("B:CXSubscribedPerson")}, {}))), expected);
    EXPECT_EQ(lines(pass()), expected);
    EXPECT_EQ(lines(pass()), expected) << "until it is sent";
    const UniqueId copy("B:CXSubscribedPerson");
    database.setCommonVersion(copy, database.personRow(copy)->encoded);
    database.save();
    EXPECT_EQ(lines(pass()), Texts{});
}

TEST_F(OwnWrites, AnEditSavedAfterTheScanIsNotOverwrittenByWhatArrivesInThatPass) {
    pass([&] { everythingArrives(); });
    pass([&] {
        const auto copy = application.recordForUniqueId(UniqueId("B:CXSubscribedPerson"));
        copy->setValue(Value("edited"), kCXNoteProperty);
        application.save();
        Dictionary content = card("Bert");
        content.set(kCXLastNameProperty, "Arrived");
        apply(CXDUpdateRecord, "bob", "B:CXSubscribedPerson", nullptr, content);
    });
    const auto copy = personAt("B:CXSubscribedPerson");
    EXPECT_EQ(copy->valueForProperty(kCXNoteProperty), Value("edited"));
    EXPECT_EQ(copy->valueForProperty(kCXLastNameProperty), Value("Arrived"));
    EXPECT_TRUE(database.hasExternalChanges()) << "it is delivered after the pass";
}

TEST_F(OwnWrites, AnEditSavedBetweenTheApplyingAndTheSaveSurvivesToo) {
    pass([&] { everythingArrives(); });
    pass([&] {
        Dictionary content = card("Bertram");
        content.set(kCXLastNameProperty, "Arrived");
        apply(CXDUpdateRecord, "bob", "B:CXSubscribedPerson", nullptr, content);
        const auto copy = application.recordForUniqueId(UniqueId("B:CXSubscribedPerson"));
        copy->setValue(Value("edited"), kCXNoteProperty);
        application.save();
    });
    const auto copy = personAt("B:CXSubscribedPerson");
    EXPECT_EQ(copy->valueForProperty(kCXNoteProperty), Value("edited"));
    EXPECT_EQ(copy->valueForProperty(kCXFirstNameProperty), Value("Bertram"));
    EXPECT_EQ(database.personRow(copy->uniqueId())->writer, "rolvane") << "an edit of a person's is still in it";
    EXPECT_TRUE(database.hasExternalChanges());
}

TEST_F(OwnWrites, AnEditThatWasCapturedAndIsNotSentIsMergedWithWhatArrives) {
    pass([&] { everythingArrives(); });
    application.recordForUniqueId(UniqueId("B:CXSubscribedPerson"))->setValue(Value("edited"), kCXNoteProperty);
    application.save();
    clock.advance(1);
    pass([&] { apply(CXDUpdateRecord, "bob", "B:CXSubscribedPerson", nullptr, card("Bertram")); });
    EXPECT_EQ(personAt("B:CXSubscribedPerson")->valueForProperty(kCXNoteProperty), Value("edited"));
    EXPECT_EQ(personAt("B:CXSubscribedPerson")->valueForProperty(kCXFirstNameProperty), Value("Bertram"));
}

TEST_F(OwnWrites, ApplyingTheSameAgainWritesNothing) {
    const Dictionary content = card("Bert");
    const auto applyAll = [&] {
        apply(CXDUpdateRecord, "bob", "B:CXSubscribedPerson", nullptr, content);
        apply(CXDCreateStructureForGroup, "bob", nullptr, "G:CXSubscribedGroup", groupPayload("Friends"));
        apply(CXDAddRecordToGroup, "bob", "B:CXSubscribedPerson", "G:CXGroup");
    };
    applyAll();
    database.save();
    const int64_t journal = database.journalPosition();
    apply(CXDUpdateRecord, "bob", "B:CXSubscribedPerson", nullptr, content);
    apply(CXDAddRecordToGroup, "bob", "B:CXSubscribedPerson", "G:CXGroup");
    database.save();
    EXPECT_EQ(database.journalPosition(), journal);
}
