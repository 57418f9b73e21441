#include "CaptureWorld.h"

#include "foundation/PropertyList.h"

#include <algorithm>

using namespace rolvane;
using namespace rolvane::test;

namespace {

class Capture : public CaptureWorld {};

const UniqueId kAllGroupUID("AllCXGroup");

std::string uid(const CXRecordRef& record) {
    return record->sharingUniqueId().str();
}

} // namespace

// -- identity

TEST_F(Capture, IsTheConduitOfTheContactDatabase) {
    EXPECT_EQ(conduit->conduitID(), "CXDCX");
    EXPECT_EQ(conduit->conduitSource(), CXDSyncSourceCX);
    EXPECT_EQ(&conduit->rolvane(), &database);
}

TEST_F(Capture, TheKillSwitchIsOnUnlessSomebodyMayWriteTheOwnersData) {
    EXPECT_TRUE(conduit->readOnlyKillSwitch()) << "no list at all";
    database.allGroup()->setValue(CXMultiValue(), kCXReadWriteSharingACLProperty);
    EXPECT_TRUE(makeConduit()->readOnlyKillSwitch()) << "an empty list";
    database.allGroup()->setValue(principals({"bob"}), kCXReadWriteSharingACLProperty);
    EXPECT_FALSE(makeConduit()->readOnlyKillSwitch());
    EXPECT_TRUE(conduit->readOnlyKillSwitch()) << "it is set once, when the conduit is made";
}

// -- people

TEST_F(Capture, APersonWhoseDatabaseIsSharedNowhereYieldsNothing) {
    const auto ada = person("Ada");
    group("Friends", {ada});
    EXPECT_EQ(lines(conduit->changesForPerson(ada, false)), Texts{});
}

TEST_F(Capture, AnInsertedPersonOfAPublishedDatabaseIsUpdatedListedAndEntersTheAllContactsGroup) {
    publishAll();
    const auto ada = person("Ada");
    const auto friends = group("Friends", {ada}), family = group("Family", {ada});
    EXPECT_EQ(lines(conduit->changesForPerson(ada, false)),
              (Texts{"1 <self> " + uid(ada) + " - 4", "9 <self> " + uid(ada) + " " + uid(friends) + " 4",
                     "9 <self> " + uid(ada) + " " + uid(family) + " 4", "5 <self> " + uid(ada) + " AllCXGroup 4"}));
}

TEST_F(Capture, AnUpdatedPersonDoesNotEnterTheAllContactsGroupAgain) {
    publishAll();
    const auto ada = person("Ada");
    const auto friends = group("Friends", {ada});
    const auto records = conduit->changesForPerson(ada, true);
    EXPECT_EQ(lines(records),
              (Texts{"1 <self> " + uid(ada) + " - 4", "9 <self> " + uid(ada) + " " + uid(friends) + " 4"}));
    EXPECT_EQ(records[0]->initialSource(), CXDSyncSourceCX);
    EXPECT_EQ(records[0]->payload(), Value(ada->dictionaryRepresentation()));
}

TEST_F(Capture, APersonOfAPublishedGroupGoesToThatGroupsLocation) {
    const auto ada = person("Ada");
    const auto friends = group("Friends", {ada});
    friends->setValue(oneLocation(kOwnLocation, kCXPublishLabel), kCXRemoteLocationProperty);
    EXPECT_EQ(lines(conduit->changesForPerson(ada, true)),
              (Texts{"1 <self> " + uid(ada) + " - 4", "9 <self> " + uid(ada) + " " + uid(friends) + " 4"}));
}

TEST_F(Capture, ALocationReachedThroughSeveralGroupsCountsOnce) {
    publishAll();
    const auto ada = person("Ada");
    for (const auto& in : {group("Friends", {ada}), group("Family", {ada})})
        in->setValue(oneLocation(kOwnLocation, kCXPublishLabel), kCXRemoteLocationProperty);
    const auto records = conduit->changesForPerson(ada, true);
    EXPECT_EQ(std::count_if(records.begin(), records.end(), [](auto& r) { return r->type() == CXDUpdateRecord; }), 1);
}

TEST_F(Capture, EveryLocationGetsARecordOfItsOwn) {
    publishAll();
    const auto ada = person("Ada");
    const auto friends = group("Friends", {ada});
    friends->setValue(oneLocation(kBobsLocation, kCXSubscribeLabel), kCXRemoteLocationProperty);
    EXPECT_EQ(lines(conduit->changesForPerson(ada, false)),
              (Texts{"1 bob " + uid(ada) + " - 4", "9 bob " + uid(ada) + " " + uid(friends) + " 4",
                     "5 bob " + uid(ada) + " AllCXGroup 4", "1 <self> " + uid(ada) + " - 4",
                     "9 <self> " + uid(ada) + " " + uid(friends) + " 4", "5 <self> " + uid(ada) + " AllCXGroup 4"}));
}

TEST_F(Capture, LocationsUnderOtherLabelsAreIgnored) {
    const auto ada = person("Ada");
    const auto friends = group("Friends", {ada});
    friends->setValue(oneLocation(kOwnLocation, "Home"), kCXRemoteLocationProperty);
    EXPECT_EQ(lines(conduit->changesForPerson(ada, true)), Texts{});
}

TEST_F(Capture, AContactOfASubscriptionGoesToItsPublisherUnderThePlainIdentifier) {
    subscribe();
    const auto carol = subscribedPerson("Carol", "C");
    database.allGroupForRemoteLocation(kBobsLocation)
        ->setValue(oneLocation(kBobsLocation, kCXSubscribeLabel), kCXRemoteLocationProperty);
    EXPECT_EQ(lines(conduit->changesForPerson(carol, false)),
              (Texts{"1 bob C:CXPerson - 4", "5 bob C:CXPerson AllCXGroup 4"}));
}

TEST_F(Capture, AContactOfALocationOnTheMachineGoesToTheSharedFolder) {
    const auto ada = person("Ada");
    const auto friends = group("Friends", {ada});
    friends->setValue(oneLocation(RemoteLocation("file:/usr/share/rolvane/carol/Friends"), kCXSubscribeLabel),
                      kCXRemoteLocationProperty);
    EXPECT_EQ(lines(conduit->changesForPerson(ada, true)),
              (Texts{"1 carol " + uid(ada) + " - 2", "9 carol " + uid(ada) + " " + uid(friends) + " 2"}));
}

TEST_F(Capture, ThePayloadStaysEncodedUntilSomebodyLooksInside) {
    publishAll();
    const auto records = conduit->changesForPerson(person("Ada"), true);
    ASSERT_FALSE(records.empty());
    ASSERT_NE(records[0]->encodedPayload(), nullptr);
    EXPECT_EQ(BinaryValue::decode(*records[0]->encodedPayload()).dictionary()[kCXFirstNameProperty], Value("Ada"));
}

// -- distribution lists

TEST_F(Capture, APersonsChoicesTravelWithItInEachOfItsGroups) {
    publishAll();
    const auto ada = person("Ada");
    CXMutableMultiValue mails;
    const std::string home = mails.addValue("ada@home", "Home");
    ada->setValue(mails, kCXEmailProperty);
    const auto friends = group("Friends", {ada}), family = group("Family", {ada});
    friends->setDistributionIdentifier(home, kCXEmailProperty, ada);
    const auto records = conduit->distributionListChangesForPerson(ada, 6, UserName("bob"));
    ASSERT_EQ(lines(records),
              (Texts{"9 bob " + uid(ada) + " " + uid(friends) + " 6", "9 bob " + uid(ada) + " " + uid(family) + " 6"}));
    EXPECT_EQ(records[0]->payload(), Value(Dictionary{{"Email", home}}));
    EXPECT_EQ(records[1]->payload(), Value(Dictionary{})) << "a group without a choice is said to have none";
}

TEST_F(Capture, AGroupsStateHoldsEveryMemberAndOnlyChoicesThatAreMade) {
    const auto ada = person("Ada"), eve = person("Eve");
    CXMutableMultiValue mails;
    const std::string home = mails.addValue("ada@home", "Home");
    ada->setValue(mails, kCXEmailProperty);
    const auto friends = group("Friends", {ada, eve});
    friends->setDistributionIdentifier(home, kCXEmailProperty, ada);
    EXPECT_EQ(Value(conduit->currentDistributionListStateForGroup(friends)),
              Value(Dictionary{{uid(ada), Dictionary{{"Email", home}}}, {uid(eve), Dictionary()}}));
}

TEST_F(Capture, AChangedChoiceOfAMemberYieldsItsWholeChoices) {
    publishAll();
    const auto ada = person("Ada");
    CXMutableMultiValue mails;
    const std::string home = mails.addValue("ada@home", "Home"), work = mails.addValue("ada@work", "Work");
    ada->setValue(mails, kCXEmailProperty);
    const auto friends = group("Friends", {ada});
    friends->setDistributionIdentifier(home, kCXEmailProperty, ada);
    knows(kSelf, friends);
    friends->setDistributionIdentifier(work, kCXEmailProperty, ada);
    const auto records = conduit->changesForGroup(friends);
    ASSERT_EQ(lines(records), Texts{"9 <self> " + uid(ada) + " " + uid(friends) + " 4"});
    EXPECT_EQ(records[0]->payload(), Value(Dictionary{{"Email", work}}));
}

// -- groups

TEST_F(Capture, AGroupWithoutLocationInAnUnsharedDatabaseYieldsNothing) {
    EXPECT_EQ(lines(conduit->changesForGroup(group("Friends", {person("Ada")}))), Texts{});
    EXPECT_EQ(lines(conduit->changesForGroup(database.allGroup())), Texts{});
    EXPECT_EQ(lines(conduit->changesForGroup(nullptr)), Texts{});
    EXPECT_TRUE(engine.priorState("CXDCX").empty());
}

TEST_F(Capture, AGroupWithoutLocationIsComparedUnderThePublishedDatabasesFirstLocation) {
    CXMutableMultiValue locations;
    locations.addValue(kBobsLocation, kCXSubscribeLabel);
    locations.addValue(kOwnLocation, kCXPublishLabel);
    database.allGroup()->setValue(locations, kCXRemoteLocationProperty);
    const auto friends = group("Friends");
    database.allGroupForRemoteLocation(kBobsLocation);
    const auto records = conduit->changesForGroup(friends);
    ASSERT_FALSE(records.empty());
    EXPECT_EQ(line(*records[0]), "2 bob - " + uid(friends) + " 4");
}

TEST_F(Capture, AGroupSeenForTheFirstTimeIsAnnouncedInOrderWithItsMembersData) {
    publishAll();
    const auto a = person("A", "A"), b = person("B", "B"); // choices come in the order of identifiers
    const auto friends = group("F", {a, b});
    EXPECT_EQ(lines(conduit->changesForGroup(friends)),
              (Texts{"2 <self> - " + uid(friends) + " 4", "6 <self> " + uid(friends) + " AllCXGroup 4",
                     "1 <self> " + uid(a) + " - 4", "9 <self> " + uid(a) + " " + uid(friends) + " 4",
                     "5 <self> " + uid(a) + " " + uid(friends) + " 4", "1 <self> " + uid(b) + " - 4",
                     "9 <self> " + uid(b) + " " + uid(friends) + " 4", "5 <self> " + uid(b) + " " + uid(friends) + " 4",
                     "4 <self> - " + uid(friends) + " 4", "9 <self> " + uid(a) + " " + uid(friends) + " 4",
                     "9 <self> " + uid(b) + " " + uid(friends) + " 4"}));
}

TEST_F(Capture, AUserMetForTheFirstTimeGetsAnEmptyEntryInThePriorState) {
    publishAll();
    conduit->changesForGroup(database.allGroup());
    EXPECT_EQ(Value(engine.priorState("CXDCX")), Value(Dictionary{{"<self>", Dictionary()}}));
}

TEST_F(Capture, TheComparisonItselfWritesNoPriorState) {
    publishAll();
    const auto friends = group("F", {person("A")});
    conduit->changesForGroup(friends);
    EXPECT_EQ(lines(conduit->changesForGroup(friends)).size(), 7u) << "a difference is found until it was applied";
    EXPECT_EQ(Value(engine.priorState("CXDCX")), Value(Dictionary{{"<self>", Dictionary()}}));
}

TEST_F(Capture, AKnownGroupThatDidNotChangeYieldsNothing) {
    publishAll();
    const auto friends = group("F", {person("A")});
    knows(kSelf, friends);
    EXPECT_EQ(lines(conduit->changesForGroup(friends)), Texts{});
}

TEST_F(Capture, TheAccessListsOfAPublishedDatabaseAreComparedAsPrincipals) {
    publishAll();
    knows(kSelf, database.allGroup());
    database.allGroup()->setValue(principals({"bob", "eve"}), kCXReadSharingACLProperty);
    database.allGroup()->setValue(principals({"bob"}), kCXReadWriteSharingACLProperty);
    const auto records = conduit->changesForGroup(database.allGroup());
    ASSERT_EQ(lines(records), (Texts{"8 <self> - AllCXGroup 4", "7 <self> - AllCXGroup 4"}));
    EXPECT_EQ(records[1]->payload(), Value(Dictionary{{"additions", Array{"bob", "eve"}}, {"deletions", Array{}}}));
}

TEST_F(Capture, ANewSubgroupIsAnnouncedBeforeItIsPutIntoItsParent) {
    publishAll();
    const auto inner = group("Inner"), outer = group("Outer");
    knows(kSelf, outer);
    outer->addSubgroup(inner);
    EXPECT_EQ(lines(conduit->changesForGroup(outer)),
              (Texts{"2 <self> - " + uid(inner) + " 4", "6 <self> " + uid(inner) + " AllCXGroup 4",
                     "4 <self> - " + uid(inner) + " 4", "6 <self> " + uid(inner) + " " + uid(outer) + " 4"}));
}

TEST_F(Capture, AMemberThatIsNoRecordAnyMoreStillYieldsItsMembership) {
    publishAll();
    EXPECT_EQ(lines(conduit->compareGroupPriorStateToCurrentState(
                  Dictionary{{kCXGroupNameProperty, "F"}},
                  Dictionary{{kCXGroupNameProperty, "F"}, {"memberUIDState", Array{"gone:CXPerson"}}},
                  UniqueId("G:CXGroup"), kOwnLocation)),
              Texts{"5 <self> gone:CXPerson G:CXGroup 4"});
}

TEST_F(Capture, AGroupThatVanishedIsDeletedAtItsLocation) {
    EXPECT_EQ(lines(conduit->compareGroupPriorStateToCurrentState(Dictionary(), Value(), UniqueId("G:CXGroup"),
                                                                  kBobsLocation)),
              Texts{"261 <self> - G:CXGroup 4"});
}

TEST_F(Capture, ManyNewMembersGiveWhatTheyGiveOneByOne) {
    publishAll();
    const auto friends = group("F", {});
    Texts expected{"2 <self> - " + uid(friends) + " 4", "6 <self> " + uid(friends) + " AllCXGroup 4"};
    std::vector<CXPersonRef> people;
    for (int i = 0; i < 40; ++i) {
        people.push_back(person(std::to_string(i).c_str()));
        friends->addMember(people.back());
    }
    for (const auto& member : people) {
        expected.push_back("1 <self> " + uid(member) + " - 4");
        expected.push_back("9 <self> " + uid(member) + " " + uid(friends) + " 4");
        expected.push_back("5 <self> " + uid(member) + " " + uid(friends) + " 4");
    }
    expected.push_back("4 <self> - " + uid(friends) + " 4");
    const auto records = conduit->changesForGroup(friends);
    const Texts got = lines(records);
    ASSERT_GE(got.size(), expected.size());
    EXPECT_EQ(Texts(got.begin(), got.begin() + static_cast<long>(expected.size())), expected);
    EXPECT_EQ(got.size(), expected.size() + 40) << "and one list record each";
}

// -- single groups of an otherwise unshared database

namespace {

class SingleGroups : public CaptureWorld {
public:
    SingleGroups() {
        database.allGroup()->setValue(CXMultiValue(), kCXRemoteLocationProperty);
        auto marker = CXSubscription::create(RemoteLocation("published-groups"), false);
        database.addRecord(marker);
        ada = person("Ada");
        shared = group("Shared", {ada});
        shared->setValue(oneLocation(kOwnLocation, kCXPublishLabel), kCXRemoteLocationProperty);
        secret = person("Eve");
        unshared = group("Unshared", {secret});
        save();
    }
    CXPersonRef ada, secret;
    CXGroupRef shared, unshared;
};

} // namespace

TEST_F(SingleGroups, AnEmptyLocationListIsNoLocation) {
    EXPECT_EQ(lines(conduit->changesForGroup(unshared)), Texts{});
    EXPECT_EQ(lines(conduit->changesForGroup(database.allGroup())), Texts{});
    EXPECT_EQ(lines(conduit->changesForPerson(secret, false)), Texts{});
}

TEST_F(SingleGroups, AreScannedWithoutTheRestOfTheDatabase) {
    conduit->open();
    const Texts all = lines(conduit->changeRecords());
    EXPECT_FALSE(all.empty());
    for (const auto& one : all) EXPECT_EQ(one.find(uid(secret)), std::string::npos) << one;
    for (const auto& call : engine.takeCalls()) EXPECT_FALSE(call.starts_with("kill")) << call;
}

// -- subscriptions

TEST_F(CaptureWorld, ASubscriptionByWhichNothingHasComeYetIsNoEditOfThePublishersList) {
    const RemoteLocation bobs("http://store/bob/Contacts");
    database.addRecord(CXSubscription::create(bobs));
    save();
    conduit->open();
    for (const auto& one : lines(conduit->changeRecords())) EXPECT_EQ(one.find(" bob "), std::string::npos) << one;
    // Once the publisher's list is known, it is compared again.
    engine.conduitObjectForKey("CXDCX", "priorState")
        .dictionaryFor("bob")
        .set("AllCXGroup", Dictionary{{"memberUIDState", Array{"GONE:CXPerson"}}});
    Texts compared = lines(conduit->changeRecords());
    std::erase_if(compared, [](const std::string& one) { return one.find(" bob ") == std::string::npos; });
    EXPECT_FALSE(compared.empty());
}

// -- lookup

TEST_F(Capture, LooksUpANormalisedIdentifierInTheSubscribedCopyFirst) {
    subscribe();
    const auto plain = person("Plain", "P"), copy = subscribedPerson("Copy", "P");
    const auto plainGroup = group("Plain", {}, "G"), copyGroup = subscribedGroup("Copy", "G");
    const auto onlyPlain = person("Other", "Q");
    EXPECT_EQ(conduit->recordForUniqueId(UniqueId("P:CXPerson"))->uniqueId(), copy->uniqueId());
    EXPECT_EQ(conduit->recordForUniqueId(UniqueId("P:CXSubscribedPerson"))->uniqueId(), copy->uniqueId());
    EXPECT_EQ(conduit->recordForUniqueId(UniqueId("G:CXGroup"))->uniqueId(), copyGroup->uniqueId());
    EXPECT_EQ(conduit->recordForUniqueId(UniqueId("Q:CXPerson"))->uniqueId(), onlyPlain->uniqueId());
    EXPECT_EQ(conduit->recordForUniqueId(UniqueId("Q:CXSubscribedPerson")), nullptr);
    EXPECT_EQ(conduit->recordForUniqueId(UniqueId("none:CXGroup")), nullptr);
    EXPECT_EQ(conduit->recordForUniqueId(UniqueId("none")), nullptr);
}

TEST_F(Capture, LooksUpTheAllContactsGroupOfTheDatabase) {
    EXPECT_EQ(conduit->recordForUniqueId(kAllGroupUID)->uniqueId(), database.allGroup()->uniqueId());
}

TEST_F(Capture, CombinesTheSourcesOfAllLocations) {
    CXMutableMultiValue locations;
    EXPECT_EQ(conduit->sourcesFromRemoteLocations(locations), 0);
    locations.addValue(kOwnLocation, kCXPublishLabel);
    EXPECT_EQ(conduit->sourcesFromRemoteLocations(locations), 4);
    locations.addValue("file:/usr/share/rolvane/ada", kCXPublishLabel);
    locations.addValue("https://store.example/ada", kCXPublishLabel);
    EXPECT_EQ(conduit->sourcesFromRemoteLocations(locations), 6);
}

TEST_F(Capture, RevokingAGroupAddressesEveryPlaceWhereItIsPublished) {
    engine.sources[UniqueId("G:CXSubscribedGroup")] = 6;
    EXPECT_EQ(lines(conduit->generateChangeRecordsToRevokeGroupUID(UniqueId("G:CXSubscribedGroup"))),
              Texts{"261 <self> - G:CXGroup 6"});
    EXPECT_EQ(lines(conduit->generateChangeRecordsToRevokeGroupUID(UniqueId("H:CXGroup"))),
              Texts{"261 <self> - H:CXGroup 0"});
}
