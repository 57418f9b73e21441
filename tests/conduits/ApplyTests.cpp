#include "ApplyWorld.h"

#include "acl/CXDCXACLManager.h"
#include "support/CapturingLog.h"

using namespace rolvane;
using namespace rolvane::test;

namespace {

class Apply : public ApplyWorld {};

constexpr int kEveryType[] = {1, 2, 3, 4, 5, 6, 7, 8, 9, 257, 258, 259, 260, 261};

Value text(const CXRecordRef& record, const char* property) {
    return record ? record->valueForProperty(property) : Value();
}

} // namespace

// -- dispatch and kill switch

TEST_F(Apply, WithoutWritersAtTheStartARecordOfTheOwnerIsCaughtLoggedAndDone) {
    database.allGroup()->removeValueForProperty(kCXReadWriteSharingACLProperty);
    person("Ada", "A");
    group("Friends", {personAt("A:CXPerson")}, "F");
    save();
    conduit = makeConduit();
    const Texts before = contents();
    const DebugLevel verbose(1);
    for (const int type : kEveryType) {
        const CapturingLog log;
        const auto bogus = record(type, "<self>", "A:CXPerson", "F:CXGroup", Dictionary{{"First", "Eve"}});
        EXPECT_TRUE(conduit->applyChangeRecord(bogus)) << type;
        EXPECT_TRUE(log.has("kill switch caught bogus record: " + bogus->description())) << log.text();
    }
    EXPECT_FALSE(database.hasUnsavedChanges());
    EXPECT_EQ(contents(), before);
}

TEST_F(Apply, WithTheKillSwitchOnARecordOfAnotherUserIsAppliedNormally) {
    database.allGroup()->removeValueForProperty(kCXReadWriteSharingACLProperty);
    conduit = makeConduit();
    EXPECT_TRUE(apply(CXDUpdateRecord, "bob", "B:CXSubscribedPerson", nullptr, card("Bert")));
    EXPECT_EQ(nameOf("B:CXSubscribedPerson"), "Bert");
}

TEST_F(Apply, CompositeChangesDistributionListRemovalsAndUnknownTypesAreLeftWithoutAWord) {
    const DebugLevel verbose(1);
    const CapturingLog log;
    for (const int type : {3, 257, 0, 10, 262, -1}) EXPECT_FALSE(apply(type, "bob", "P", "G")) << type;
    EXPECT_EQ(log.lines(), Texts{});
    EXPECT_FALSE(database.hasUnsavedChanges());
}

TEST_F(Apply, ARecordWhosePersonOrGroupIsGoneCountsAsApplied) {
    for (const int type : {4, 5, 6, 7, 9, 258, 259, 260, 261})
        EXPECT_TRUE(apply(type, "bob", "gone:CXPerson", "gone:CXGroup", Dictionary{{"Email", "x"}})) << type;
    EXPECT_FALSE(database.hasUnsavedChanges());
}

TEST_F(Apply, ARecordWithoutThePersonOrGroupThatItsTypeNeedsChangesNothing) {
    for (const int type : kEveryType) {
        if (type == 3 || type == 257) continue;
        EXPECT_TRUE(apply(type, "bob", nullptr, nullptr)) << type;
    }
    EXPECT_FALSE(database.hasUnsavedChanges());
}

TEST_F(Apply, NothingIsSavedBeforeThePassEndsButNewGroups) {
    apply(CXDUpdateRecord, "bob", "B:CXSubscribedPerson", nullptr, card("Bert"));
    EXPECT_TRUE(database.hasUnsavedChanges());
    apply(CXDCreateStructureForGroup, "bob", nullptr, "G:CXSubscribedGroup", groupPayload("Friends"));
    EXPECT_FALSE(database.hasUnsavedChanges());
    apply(CXDAddRecordToGroup, "bob", "B:CXSubscribedPerson", "G:CXSubscribedGroup");
    EXPECT_TRUE(database.hasUnsavedChanges());
    conduit->open();
    conduit->close();
    EXPECT_FALSE(database.hasUnsavedChanges());
}

// -- people

TEST_F(Apply, AnUnknownPersonOfTheOwnerIsMadeWithoutTheRemoteLocationOfThePayload) {
    EXPECT_TRUE(apply(CXDUpdateRecord, "<self>", "A:CXPerson", nullptr, card("Ada")));
    const auto made = personAt("A:CXPerson");
    ASSERT_TRUE(made);
    EXPECT_FALSE(made->isSubscribed());
    EXPECT_EQ(made->dictionaryRepresentation(), (Dictionary{{kCXFirstNameProperty, "Ada"}}));
}

TEST_F(Apply, AnUnknownSubscribedPersonIsMadeAndKeepsTheRemoteLocation) {
    const Dictionary content = card("Bert");
    EXPECT_TRUE(apply(CXDUpdateRecord, "bob", "B:CXSubscribedPerson", nullptr, content));
    const auto made = personAt("B:CXSubscribedPerson");
    ASSERT_TRUE(std::dynamic_pointer_cast<CXSubscribedPerson>(made));
    EXPECT_EQ(made->dictionaryRepresentation(), content);
    EXPECT_EQ(made->remoteLocation(), kBobsLocation);
}

TEST_F(Apply, TheRecordsOwnPayloadStaysAsItIs) {
    const Dictionary content = card("Ada");
    const auto update = record(CXDUpdateRecord, "<self>", "A:CXPerson", nullptr, content.mutableCopy());
    conduit->applyChangeRecord(update);
    EXPECT_EQ(update->payload(), Value(content));
}

TEST_F(Apply, AnUpdateReplacesAllPropertiesOfTheCopy) {
    subscribedPerson("Bert", "B")->setValue(Value("a note"), kCXNoteProperty);
    EXPECT_TRUE(apply(CXDUpdateRecord, "bob", "B:CXSubscribedPerson", nullptr, card("Bertram")));
    EXPECT_EQ(nameOf("B:CXSubscribedPerson"), "Bertram");
    EXPECT_FALSE(text(personAt("B:CXSubscribedPerson"), kCXNoteProperty));
}

TEST_F(Apply, UnknownPropertiesAreLeftOutAndIdentifiersOfValuesAreKept) {
    Dictionary content = card("Bert");
    content.set("FavouriteColour", "blue");
    CXMutableMultiValue mails;
    const std::string home = mails.addValue("bert@home", "Home");
    content.set(kCXEmailProperty, mails.toValue());
    apply(CXDUpdateRecord, "bob", "B:CXSubscribedPerson", nullptr, content);
    EXPECT_FALSE(text(personAt("B:CXSubscribedPerson"), "FavouriteColour"));
    EXPECT_EQ(text(personAt("B:CXSubscribedPerson"), kCXEmailProperty), mails.toValue());
}

TEST_F(Apply, ASharedIdentifierFindsTheSubscribedCopyBeforeThePlainRecord) {
    person("Own", "B");
    subscribedPerson("Bert", "B");
    EXPECT_TRUE(apply(CXDDeleteRecord, "bob", "B:CXPerson", nullptr));
    EXPECT_EQ(nameOf("B:CXSubscribedPerson"), "(gone)");
    EXPECT_EQ(nameOf("B:CXPerson"), "Own");
}

TEST_F(Apply, ACopyThatTheSharedIdentifierFindsStaysWhereItCameFrom) {
    subscribedPerson("Bert", "B");
    EXPECT_TRUE(apply(CXDUpdateRecord, "<self>", "B:CXPerson", nullptr, card("Bertram", kOwnLocation)));
    EXPECT_EQ(nameOf("B:CXSubscribedPerson"), "Bertram");
    EXPECT_EQ(personAt("B:CXSubscribedPerson")->remoteLocation(), kBobsLocation);
}

TEST_F(Apply, AFloodOfContentDoesNotWaitInMemoryForTheEndOfThePass) {
    const Bytes photo(3 << 20, 7);
    size_t most = 0;
    for (int i = 0; i < 15; i++) {
        Dictionary content = card("Bert");
        content.set(kCXPhotoProperty, photo);
        apply(CXDUpdateRecord, "bob", ("B" + std::to_string(i) + ":CXSubscribedPerson").c_str(), nullptr, content);
        most = std::max(most, database.unsavedSize());
    }
    EXPECT_LE(most, size_t{32} << 20);
    EXPECT_EQ(database.countPeople(kBobsLocation), 15u);
}

TEST_F(Apply, DeletingAPersonTakesItsMembershipsAlong) {
    const auto bert = subscribedPerson("Bert", "B");
    subscribedGroup("Friends", "G")->addMember(bert);
    EXPECT_TRUE(apply(CXDDeleteRecord, "bob", "B:CXPerson", nullptr));
    EXPECT_EQ(groupAt("G:CXSubscribedGroup")->memberCount(), 0u);
}

// -- delayed payloads

TEST_F(Apply, ADelayedPayloadIsReadOnceAndTheStampIsLaidOverIt) {
    const Url url("http://store.example/bob/Contacts/People/3/B");
    files.files[url.absoluteString()] = {{kCXFirstNameProperty, "Bert"}, {kCXRemoteLocationProperty, "theirs"}};
    Dictionary stamp;
    conduit->stampWithRemoteLocation(stamp, kBobsLocation);
    const auto update = record(CXDUpdateRecord, "bob", "B:CXSubscribedPerson", nullptr, stamp);
    update->setDelayedPayloadURL(url, &files);
    EXPECT_TRUE(conduit->applyChangeRecord(update));
    EXPECT_EQ(files.reads, 1);
    EXPECT_EQ(nameOf("B:CXSubscribedPerson"), "Bert");
    EXPECT_EQ(personAt("B:CXSubscribedPerson")->remoteLocation(), kBobsLocation);
}

TEST_F(Apply, AContactWhoseContentCannotBeReadKeepsWhatItHas) {
    subscribedPerson("Bert", "B");
    save();
    Dictionary stamp;
    conduit->stampWithRemoteLocation(stamp, kBobsLocation);
    const auto update = record(CXDUpdateRecord, "bob", "B:CXSubscribedPerson", nullptr, stamp);
    update->setDelayedPayloadURL(Url("http://store.example/bob/Contacts/People/3/B"), &files);
    EXPECT_TRUE(conduit->applyChangeRecord(update)) << "the next listing shows the version again";
    EXPECT_EQ(nameOf("B:CXSubscribedPerson"), "Bert");
    EXPECT_FALSE(database.hasUnsavedChanges());
}

TEST_F(Apply, AContactThatWasNeverReadIsNotMadeEmpty) {
    Dictionary stamp;
    conduit->stampWithRemoteLocation(stamp, kBobsLocation);
    // As it comes out of a stored queue: without the way to its content.
    EXPECT_TRUE(apply(CXDUpdateRecord, "bob", "B:CXSubscribedPerson", nullptr, stamp));
    EXPECT_TRUE(apply(CXDUpdateRecord, "<self>", "A:CXPerson", nullptr, Dictionary()));
    EXPECT_EQ(nameOf("B:CXSubscribedPerson"), "(gone)");
    EXPECT_EQ(nameOf("A:CXPerson"), "(gone)");
}

TEST_F(Apply, AContactThatTheStoreSaysIsEmptyBecomesEmpty) {
    subscribedPerson("Bert", "B");
    const Url url("http://store.example/bob/Contacts/People/3/B");
    files.files[url.absoluteString()] = {};
    Dictionary stamp;
    conduit->stampWithRemoteLocation(stamp, kBobsLocation);
    const auto update = record(CXDUpdateRecord, "bob", "B:CXSubscribedPerson", nullptr, stamp);
    update->setDelayedPayloadURL(url, &files);
    EXPECT_TRUE(conduit->applyChangeRecord(update));
    EXPECT_EQ(nameOf("B:CXSubscribedPerson"), "");
    EXPECT_EQ(personAt("B:CXSubscribedPerson")->remoteLocation(), kBobsLocation);
}

// -- groups

TEST_F(Apply, ANewGroupOfAnotherUserIsASubscribedOneWithItsLocation) {
    EXPECT_TRUE(apply(CXDCreateStructureForGroup, "bob", nullptr, "G:CXSubscribedGroup", groupPayload("Friends")));
    const auto made = groupAt("G:CXSubscribedGroup");
    ASSERT_TRUE(std::dynamic_pointer_cast<CXSubscribedGroup>(made));
    EXPECT_EQ(made->name(), "Friends");
    EXPECT_EQ(made->remoteLocation(), kBobsLocation);
    EXPECT_EQ(database.allGroupForRemoteLocation(kBobsLocation)->subgroupUniqueIds(),
              std::vector{UniqueId("G:CXSubscribedGroup")});
}

TEST_F(Apply, ANewGroupOfTheOwnerTakesNoLocationFromOutside) {
    EXPECT_TRUE(apply(CXDCreateStructureForGroup, "<self>", nullptr, "G:CXGroup", groupPayload("Friends")));
    EXPECT_EQ(groupAt("G:CXGroup")->dictionaryRepresentation(), (Dictionary{{kCXGroupNameProperty, "Friends"}}));
}

TEST_F(Apply, CreatingAGroupThatIsThereKeepsItsMembersAndWhatTheRecordDoesNotName) {
    const auto friends = group("Friends", {person("Ada", "A")}, "F");
    friends->setValue(oneLocation(kOwnLocation, kCXPublishLabel), kCXRemoteLocationProperty);
    save();
    EXPECT_TRUE(apply(CXDCreateStructureForGroup, "<self>", nullptr, "F:CXGroup", groupPayload("Pals")));
    EXPECT_EQ(database.listGroups(std::nullopt).size(), 1u);
    EXPECT_EQ(groupAt("F:CXGroup")->name(), "Pals");
    EXPECT_EQ(groupAt("F:CXGroup")->memberCount(), 1u);
    EXPECT_TRUE(text(groupAt("F:CXGroup"), kCXRemoteLocationProperty)) << "it is still published";
    EXPECT_TRUE(apply(CXDCreateStructureForGroup, "<self>", nullptr, "F:CXGroup", Dictionary()));
    EXPECT_EQ(groupAt("F:CXGroup")->name(), "Pals");
}

TEST_F(Apply, TheAllContactsGroupIsNeitherMadeNorNamedNorFilledNorAskedForReaders) {
    person("Ada", "A");
    group("Friends", {}, "F");
    save();
    const Texts before = contents();
    for (const char* all : {"AllCXGroup", "AllCXSubscribedGroup"}) {
        EXPECT_TRUE(apply(CXDCreateStructureForGroup, "<self>", nullptr, all, groupPayload("Everybody")));
        EXPECT_TRUE(apply(CXDChangeGroupName, "<self>", nullptr, all, "Everybody"));
        EXPECT_TRUE(apply(CXDAddRecordToGroup, "<self>", "A:CXPerson", all));
        EXPECT_TRUE(apply(CXDAddGroupToGroup, "<self>", "F:CXGroup", all));
        EXPECT_TRUE(apply(CXDChangeGroupReadACL, "<self>", nullptr, all, Dictionary{{"additions", Array{"carol"}}}));
    }
    EXPECT_FALSE(database.hasUnsavedChanges());
    EXPECT_EQ(contents(), before);
}

TEST_F(Apply, AGroupIsRenamedUnderEitherIdentifier) {
    subscribedGroup("Friends", "G");
    EXPECT_TRUE(apply(CXDChangeGroupName, "bob", nullptr, "G:CXGroup", "Pals"));
    EXPECT_EQ(nameOf("G:CXSubscribedGroup"), "Pals");
    EXPECT_TRUE(apply(CXDChangeGroupName, "bob", nullptr, "G:CXSubscribedGroup", "Mates"));
    EXPECT_EQ(nameOf("G:CXSubscribedGroup"), "Mates");
}

TEST_F(Apply, AGroupNeverLosesItsName) {
    subscribedGroup("Friends", "G");
    for (const Value& none : {Value(), Value(""), Value(Dictionary())})
        EXPECT_TRUE(apply(CXDChangeGroupName, "bob", nullptr, "G:CXGroup", none));
    EXPECT_EQ(nameOf("G:CXSubscribedGroup"), "Friends");
}

TEST_F(Apply, DeletingAGroupLeavesItsMembers) {
    const auto bert = subscribedPerson("Bert", "B");
    subscribedGroup("Friends", "G")->addMember(bert);
    EXPECT_TRUE(apply(CXDDeleteGroup, "bob", nullptr, "G:CXGroup"));
    EXPECT_EQ(nameOf("G:CXSubscribedGroup"), "(gone)");
    EXPECT_EQ(nameOf("B:CXSubscribedPerson"), "Bert");
}

TEST_F(Apply, DeletingTheAllContactsGroupIsAskedOfTheDatabaseWhichRefuses) {
    const CapturingLog log;
    EXPECT_TRUE(apply(CXDDeleteGroup, "<self>", nullptr, "AllCXGroup"));
    EXPECT_TRUE(log.has("An all-contacts group cannot be removed; AllCXGroup stays.")) << log.text();
    EXPECT_TRUE(database.allGroup());
}

// -- membership

TEST_F(Apply, MembersComeAndGoUnderEitherIdentifier) {
    subscribedPerson("Bert", "B");
    subscribedGroup("Friends", "G");
    EXPECT_TRUE(apply(CXDAddRecordToGroup, "bob", "B:CXSubscribedPerson", "G:CXSubscribedGroup"));
    EXPECT_EQ(groupAt("G:CXSubscribedGroup")->memberUniqueIds(), std::vector{UniqueId("B:CXSubscribedPerson")});
    EXPECT_TRUE(apply(CXDAddRecordToGroup, "bob", "B:CXSubscribedPerson", "G:CXGroup"));
    EXPECT_EQ(groupAt("G:CXSubscribedGroup")->memberCount(), 1u) << "nobody is listed twice";
    EXPECT_TRUE(apply(CXDRemoveRecordFromGroup, "bob", "B:CXPerson", "G:CXGroup"));
    EXPECT_EQ(groupAt("G:CXSubscribedGroup")->memberCount(), 0u);
    EXPECT_EQ(nameOf("B:CXSubscribedPerson"), "Bert") << "leaving a group is not leaving the database";
}

TEST_F(Apply, LeavingTheAllContactsGroupIsLeavingTheDatabase) {
    person("Ada", "A");
    subscribedPerson("Bert", "B");
    EXPECT_TRUE(apply(CXDRemoveRecordFromGroup, "<self>", "A:CXPerson", "AllCXGroup"));
    EXPECT_TRUE(apply(CXDRemoveRecordFromGroup, "bob", "B:CXPerson", "AllCXGroup"));
    EXPECT_EQ(nameOf("A:CXPerson"), "(gone)");
    EXPECT_EQ(nameOf("B:CXSubscribedPerson"), "(gone)");
}

TEST_F(Apply, SubgroupsComeAndGo) {
    subscribedGroup("Friends", "G");
    subscribedGroup("Best", "H");
    EXPECT_TRUE(apply(CXDAddGroupToGroup, "bob", "H:CXGroup", "G:CXGroup"));
    EXPECT_EQ(groupAt("G:CXSubscribedGroup")->subgroupUniqueIds(), std::vector{UniqueId("H:CXSubscribedGroup")});
    EXPECT_TRUE(apply(CXDRemoveGroupFromGroup, "bob", "H:CXGroup", "G:CXGroup"));
    EXPECT_TRUE(groupAt("G:CXSubscribedGroup")->subgroupUniqueIds().empty());
    EXPECT_EQ(nameOf("H:CXSubscribedGroup"), "Best");
    EXPECT_TRUE(apply(CXDRemoveGroupFromGroup, "bob", "H:CXGroup", "AllCXGroup"));
    EXPECT_EQ(nameOf("H:CXSubscribedGroup"), "(gone)");
}

TEST_F(Apply, AGroupThatWouldContainItselfIsLeftOutAndNotTriedForEver) {
    subscribedGroup("Friends", "G");
    subscribedGroup("Best", "H");
    EXPECT_TRUE(apply(CXDAddGroupToGroup, "bob", "H:CXGroup", "G:CXGroup"));
    EXPECT_TRUE(apply(CXDAddGroupToGroup, "bob", "G:CXGroup", "H:CXGroup"));
    EXPECT_TRUE(apply(CXDAddGroupToGroup, "bob", "G:CXGroup", "G:CXGroup"));
    EXPECT_TRUE(apply(CXDAddGroupToGroup, "<self>", "AllCXGroup", "G:CXGroup"));
    EXPECT_TRUE(groupAt("H:CXSubscribedGroup")->subgroupUniqueIds().empty());
    EXPECT_EQ(groupAt("G:CXSubscribedGroup")->subgroupUniqueIds(), std::vector{UniqueId("H:CXSubscribedGroup")});
}

// -- distribution lists

class Choices : public Apply {
public:
    Choices() {
        bert = subscribedPerson("Bert", "B");
        friends = subscribedGroup("Friends", "G");
        friends->addMember(bert);
        for (const char* property : {kCXAddressProperty, kCXEmailProperty, kCXPhoneProperty, kCXURLsProperty})
            friends->setDistributionIdentifier("old", property, bert);
    }
    std::string choice(const char* property) {
        return friends->distributionIdentifierForProperty(property, bert).value_or("-");
    }
    CXPersonRef bert;
    CXGroupRef friends;
};

TEST_F(Choices, APayloadThatNamesOnlyEmailClearsAddressAndPhone) {
    EXPECT_TRUE(
        apply(CXDUpdateDistributionList, "bob", "B:CXPerson", "G:CXGroup", Dictionary{{kCXEmailProperty, "new"}}));
    EXPECT_EQ(choice(kCXEmailProperty), "new");
    EXPECT_EQ(choice(kCXAddressProperty), "-");
    EXPECT_EQ(choice(kCXPhoneProperty), "-");
    EXPECT_EQ(choice(kCXURLsProperty), "old") << "others are not written";
}

TEST_F(Choices, AnEmptyPayloadClearsAllThreeAndNoPayloadNone) {
    EXPECT_TRUE(apply(CXDUpdateDistributionList, "bob", "B:CXPerson", "G:CXGroup"));
    EXPECT_EQ(choice(kCXEmailProperty), "old");
    EXPECT_TRUE(apply(CXDUpdateDistributionList, "bob", "B:CXPerson", "G:CXGroup", Dictionary()));
    EXPECT_EQ(choice(kCXEmailProperty), "-");
}

TEST_F(Choices, AMissingPersonOrGroupChangesNothing) {
    const Dictionary payload{{kCXEmailProperty, "new"}};
    EXPECT_TRUE(apply(CXDUpdateDistributionList, "bob", "X:CXPerson", "G:CXGroup", payload));
    EXPECT_TRUE(apply(CXDUpdateDistributionList, "bob", "B:CXPerson", "X:CXGroup", payload));
    EXPECT_EQ(choice(kCXEmailProperty), "old");
}

// -- access lists

TEST_F(Apply, ReadAccessIsNotCarriedIntoTheDatabase) {
    subscribedGroup("Friends", "G");
    save();
    EXPECT_TRUE(apply(CXDChangeGroupReadACL, "bob", nullptr, "G:CXGroup", Dictionary{{"additions", Array{"<self>"}}}));
    EXPECT_TRUE(conduit->saveACLs());
    EXPECT_FALSE(database.hasUnsavedChanges());
}

TEST_F(Apply, WriteAccessIsGrantedAndDeniedThroughTheLocationsManager) {
    const auto all = [&] { return database.allGroupForRemoteLocation(kBobsLocation); };
    EXPECT_TRUE(apply(CXDChangeGroupReadWriteACL, "bob", nullptr, "AllCXGroup",
                      Dictionary{{"additions", Array{"<self>"}}, {"deletions", Array{}}}));
    EXPECT_FALSE(all()->multiValueForProperty(kCXReadWriteSharingACLProperty)) << "the manager's save writes it";
    conduit->saveACLs();
    ASSERT_TRUE(all()->multiValueForProperty(kCXReadWriteSharingACLProperty));
    EXPECT_EQ(all()->multiValueForProperty(kCXReadWriteSharingACLProperty)->count(), 1u);
    EXPECT_TRUE(
        apply(CXDChangeGroupReadWriteACL, "bob", nullptr, "AllCXGroup", Dictionary{{"deletions", Array{"<self>"}}}));
    conduit->saveACLs();
    EXPECT_FALSE(all()->multiValueForProperty(kCXReadWriteSharingACLProperty));
}

TEST_F(Apply, WhoSubscribesAgainAfterARevocationDoesNotInheritTheRightToWrite) {
    apply(CXDChangeGroupReadWriteACL, "bob", nullptr, "AllCXGroup", Dictionary{{"additions", Array{"<self>"}}});
    conduit->saveACLs();
    ASSERT_TRUE(
        database.allGroupForRemoteLocation(kBobsLocation)->multiValueForProperty(kCXReadWriteSharingACLProperty));
    engine.revoked = {kBobsLocation};
    database.removeRecord(database.findSubscriptionWithRemoteLocation(kBobsLocation));
    save();
    conduit->close();

    engine.revoked.clear();
    subscribe();
    save();
    conduit->saveACLs();
    EXPECT_FALSE(
        database.allGroupForRemoteLocation(kBobsLocation)->multiValueForProperty(kCXReadWriteSharingACLProperty));
}

TEST_F(Apply, WhatIsGrantedAndDeniedAtOnceIsDenied) {
    EXPECT_TRUE(apply(CXDChangeGroupReadWriteACL, "bob", nullptr, "AllCXGroup",
                      Dictionary{{"additions", Array{"<self>"}}, {"deletions", Array{"<self>"}}}));
    conduit->saveACLs();
    EXPECT_FALSE(
        database.allGroupForRemoteLocation(kBobsLocation)->multiValueForProperty(kCXReadWriteSharingACLProperty));
}

TEST_F(Apply, AnAccessListChangeOfASourceWithoutALocationChangesNothing) {
    engine.conduits.clear();
    EXPECT_TRUE(
        apply(CXDChangeGroupReadWriteACL, "bob", nullptr, "G:CXGroup", Dictionary{{"additions", Array{"<self>"}}}));
    conduit->saveACLs();
    EXPECT_FALSE(database.hasUnsavedChanges());
}

TEST_F(Apply, ALocationThatIsNotItsOwnBaseLocationGetsAnotherManagerAtEachCall) {
    const Url location(kBobsLocation.str());
    const auto first = conduit->ACLManagerForRemoteLocation(location);
    ASSERT_TRUE(std::dynamic_pointer_cast<CXDCXACLManager>(first));
    EXPECT_EQ(first->baseLocation().absoluteString(), kBobsLocation.str());
    EXPECT_NE(conduit->ACLManagerForRemoteLocation(location), first);
}

TEST_F(Apply, ALocationThatIsItsOwnBaseLocationKeepsItsManager) {
    class WithLocations : public CXDCXConduit {
    public:
        using CXDCXConduit::CXDCXConduit;
        std::optional<Url> baseLocationForUser(const std::optional<UserName>& user) const override {
            return Url("http://store.example/" + user.value_or(UserName()).str() + "/Contacts");
        }
    };
    WithLocations rooted(engine, {database, preferences, clock, center, 1, "another program"});
    const auto first = rooted.ACLManagerForRemoteLocation(Url(kBobsLocation.str()));
    EXPECT_EQ(rooted.ACLManagerForRemoteLocation(Url(kBobsLocation.str())), first);
    EXPECT_EQ(rooted.ACLManagerForRemoteLocation(Url(kBobsLocation.str() + "/Friends")), first);
}

// A clock that lets another program save at the moment when a change is noted.
class SavingClock : public Clock {
public:
    explicit SavingClock(const Clock& clock) : _clock(clock) {}
    Date now() const override {
        if (const auto save = std::exchange(saves, nullptr)) save();
        return _clock.now();
    }
    mutable std::function<void()> saves;

private:
    const Clock& _clock;
};

TEST_F(Apply, WhatAnotherProgramSavesWhileAVersionIsTakenInStays) {
    const auto ada = person("Ada", "A");
    save();
    database.setCommonVersion(ada->uniqueId(), ada->encodedRepresentation());
    save();
    SavingClock saving(clock);
    CXRolvane::Options options = daemonDatabase(directory, clock, center);
    options.clock = &saving;
    CXRolvane own(options);
    CXDCXConduit conduitOfOwn(engine, {own, preferences, saving, center, 1, "another program"});
    saving.saves = [&] {
        ada->setValue("typed meanwhile", kCXNoteProperty);
        database.save();
    };
    Dictionary arrived = card("Ada", kOwnLocation);
    arrived.set(kCXOrganizationProperty, "theirs");
    bool denied = false;
    EXPECT_TRUE(
        conduitOfOwn.applyChangeRecord(record(CXDUpdateRecord, "<self>", "A:CXPerson", nullptr, arrived), &denied));
    EXPECT_FALSE(saving.saves) << "it was saved";
    own.save();
    EXPECT_EQ(ada->valueForProperty(kCXOrganizationProperty).string(), "theirs");
    EXPECT_EQ(ada->valueForProperty(kCXNoteProperty).string(), "typed meanwhile");
}

// -- whose it is

TEST_F(Apply, AnotherUsersRecordNeverReachesTheOwnersOwnPeopleAndGroups) {
    const auto ada = person("Ada", "A");
    group("Own", {ada}, "F");
    group("Inner", {}, "H");
    subscribedGroup("Friends", "G");
    groupAt("F:CXGroup")->addSubgroup(groupAt("H:CXGroup"));
    save();
    const Texts before = contents();
    for (const char* group : {"F:CXGroup", "G:CXGroup", "AllCXGroup"})
        for (const char* person : {"A:CXPerson", "H:CXGroup", "F:CXGroup"})
            for (const int type : kEveryType) {
                if (type == 2 || (type == 4 && group[0] == 'G') || (type == 261 && group[0] == 'G')) continue;
                apply(type, "bob", person, group, type == 4 ? Value("Eve") : Value(card("Eve")));
            }
    EXPECT_TRUE(apply(CXDCreateStructureForGroup, "bob", nullptr, "F:CXGroup", groupPayload("Eve")));
    EXPECT_EQ(contents(), before);
}

TEST_F(Apply, AnotherUsersRecordNeverReachesTheCopiesOfAThirdUser) {
    const RemoteLocation carols("http://store.example/carol/Contacts");
    subscribe(carols);
    const auto carl = subscribedPerson("Carl", "C", carols);
    subscribedGroup("Carols", "G", carols)->addMember(carl);
    save();
    const Texts before = contents();
    for (const int type : kEveryType)
        apply(type, "bob", "C:CXSubscribedPerson", "G:CXSubscribedGroup",
              type == 4 ? Value("Eve") : Value(card("Eve")));
    EXPECT_EQ(contents(), before);
    EXPECT_TRUE(apply(CXDUpdateRecord, "carol", "C:CXSubscribedPerson", nullptr, card("Karl", carols)));
    EXPECT_EQ(nameOf("C:CXSubscribedPerson"), "Karl");
}

TEST_F(Apply, WhatIsNoPersonOrGroupIsNotTakenForOne) {
    subscribedGroup("Friends", "G");
    const std::string subscription = database.findSubscriptionWithRemoteLocation(kBobsLocation)->uniqueId().str();
    save();
    const Texts before = contents();
    for (const char* user : {"bob", "<self>"})
        for (const char* named : {subscription.c_str(), "G:CXSubscribedGroup", "G:CXGroupContents", "", ":", "Person"})
            for (const int type : {5, 9, 258, 260}) EXPECT_TRUE(apply(type, user, named, "AllCXGroup", card("Eve")));
    for (const char* user : {"bob", "<self>"})
        for (const int type : {4, 261}) EXPECT_TRUE(apply(type, user, nullptr, subscription.c_str(), "Eve"));
    EXPECT_EQ(contents(), before);
}
