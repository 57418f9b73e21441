#include "TestDatabase.h"

#include "support/CapturingLog.h"

namespace rolvane::test {
namespace {

const RemoteLocation kBob{"http://store.example/bob/Contacts"};

TEST(Subscription, EveryDatabaseHasTheBuiltInLocalOne) {
    TestDatabase d;
    auto all = d->subscriptions();
    ASSERT_EQ(all.size(), 1u);
    EXPECT_EQ(all[0]->remoteLocation().str(), "local");
    EXPECT_FALSE(all[0]->_isAll());
    EXPECT_TRUE(all[0]->isLocal());
    d.reopen();
    EXPECT_EQ(d->subscriptions().size(), 1u);
}

TEST(Subscription, OneToAnotherPersonMakesTwoEntriesTheLocalOneFirst) {
    TestDatabase d;
    CXSubscriptionRef bob = CXSubscription::create(kBob, true, "Bob");
    d->addRecord(bob);
    for (int round = 0; round < 2; round++, d->save()) {
        auto all = d->subscriptions();
        ASSERT_EQ(all.size(), 2u);
        EXPECT_TRUE(all[0]->isLocal());
        EXPECT_EQ(all[1]->remoteLocation(), kBob);
        EXPECT_TRUE(all[1]->_isAll());
        EXPECT_EQ(all[1]->name(), "Bob");
        EXPECT_EQ(d->findSubscriptionWithRemoteLocation(kBob), bob);
    }
    EXPECT_TRUE(bob->uniqueId().endsWith("CXSubscriptionRecord"));
}

TEST(Subscription, TheLocationsAllContactsGroupIsAQueryByLocation) {
    TestDatabase d;
    d->addRecord(CXSubscription::create(kBob));
    d.addPerson("Mine");
    CXPersonRef theirs = d.addSubscribedPerson("Theirs", kBob.str());
    d.addSubscribedPerson("Other", "http://store.example/carol/Contacts");
    CXGroupRef group = CXGroup::initWithUniqueId(UniqueId("G:CXSubscribedGroup"));
    group->setValue(TestDatabase::from(kBob.str()), kCXRemoteLocationProperty);
    d->addRecord(group);
    for (int round = 0; round < 2; round++, d->save()) {
        CXAllGroupRef all = d->allGroupForRemoteLocation(kBob);
        ASSERT_TRUE(all);
        EXPECT_EQ(names(all->members()), (std::vector<std::string>{"Theirs"}));
        EXPECT_EQ(all->subgroupIdentifiers(), (std::vector<UniqueId>{UniqueId("G:CXGroup")}));
        EXPECT_EQ(all->sharingUniqueId().str(), "AllCXGroup");
        EXPECT_TRUE(all->isSubscribed());
        EXPECT_EQ(all->name(), "All Contacts");
        EXPECT_EQ(all->remoteLocation(), kBob);
        EXPECT_EQ(all->subscription(), d->findSubscriptionWithRemoteLocation(kBob));
        EXPECT_EQ(all->multiValueForProperty(kCXRemoteLocationProperty)->labelAtIndex(0), kCXSubscribeLabel);
        EXPECT_EQ(theirs->remoteLocation(), kBob);
        EXPECT_EQ(d->recordForUniqueId(all->uniqueId()), all);
        EXPECT_TRUE(all->uniqueId().endsWith("CXSubscribedGroup"));
    }
}

TEST(Subscription, ALocationThatNobodySubscribedHasNoGroup) {
    TestDatabase d;
    EXPECT_EQ(d->allGroupForRemoteLocation(kBob), nullptr);
    EXPECT_EQ(d->allGroupForRemoteLocation(RemoteLocation("")), nullptr);
    EXPECT_EQ(d->allGroupForRemoteLocation(RemoteLocation("local")), d->allGroup());
    EXPECT_EQ(d->findSubscriptionWithRemoteLocation(kBob), nullptr);
}

TEST(Subscription, TheSharingPropertiesOfALocationStayWithItsGroup) {
    TestDatabase d;
    d->addRecord(CXSubscription::create(kBob));
    CXMutableMultiValue me;
    me.addValue("alice", "alice");
    d->allGroupForRemoteLocation(kBob)->setValue(me, kCXReadWriteSharingACLProperty);
    d->save();
    d.reopen();
    EXPECT_EQ(d->allGroupForRemoteLocation(kBob)->multiValueForProperty(kCXReadWriteSharingACLProperty), me);
    EXPECT_FALSE(d->allGroup()->multiValueForProperty(kCXReadWriteSharingACLProperty));
}

TEST(Subscription, RemovingOneRemovesWhatCameByItAndNothingElse) {
    TestDatabase d;
    CXSubscriptionRef bob = CXSubscription::create(kBob);
    d->addRecord(bob);
    d.addPerson("Mine");
    d.addSubscribedPerson("Theirs", kBob.str());
    d.addSubscribedPerson("Other", "http://store.example/carol/Contacts");
    d->save();
    d.addSubscribedPerson("Unsaved", kBob.str());
    EXPECT_TRUE(d->removeRecord(bob));
    for (int round = 0; round < 2; round++, d->save()) {
        EXPECT_EQ(d->subscriptions().size(), 1u);
        EXPECT_EQ(d->allGroupForRemoteLocation(kBob), nullptr);
        EXPECT_EQ(d->countPeople(kBob), 0u);
        EXPECT_EQ(d->countPeople(std::nullopt), 2u);
    }
}

TEST(Subscription, RemovingOneAlsoRemovesWhatAnotherProcessAddedMeanwhile) {
    TestDatabase d;
    CXSubscriptionRef bob = CXSubscription::create(kBob);
    d->addRecord(bob);
    d->save();
    d->removeRecord(bob);
    auto other = d.open("rolvane");
    CXPersonRef late = CXPerson::initWithUniqueId(makeUniqueId(kCXSubscribedPersonTable));
    late->setValue(TestDatabase::from(kBob.str()), kCXRemoteLocationProperty);
    other->addRecord(late);
    other->save();
    d->save();
    EXPECT_EQ(d->countPeople(std::nullopt), 0u);
}

TEST(Subscription, TheLocalOneCannotBeRemovedOrMoved) {
    TestDatabase d;
    CapturingLog log;
    EXPECT_FALSE(d->removeRecord(d->subscriptions()[0]));
    EXPECT_EQ(log.lines().size(), 1u);
    EXPECT_FALSE(d->subscriptions()[0]->setValue("http://x", kCXRemoteLocationProperty));
    EXPECT_FALSE(d->hasUnsavedChanges());
}

TEST(Subscription, ALocationIsSubscribedOnce) {
    TestDatabase d;
    d->addRecord(CXSubscription::create(kBob));
    EXPECT_THROW(d->addRecord(CXSubscription::create(kBob)), CXException);
    EXPECT_THROW(d->addRecord(CXSubscription::create(RemoteLocation("local"))), CXException);
    EXPECT_THROW(d->addRecord(CXSubscription::create(RemoteLocation(""))), CXException);
    EXPECT_EQ(d->subscriptions().size(), 2u);
}

TEST(Subscription, AStampedPayloadPutsThePersonWhereItCameFrom) {
    TestDatabase d;
    d->addRecord(CXSubscription::create(kBob));
    CXPersonRef person = CXPerson::initWithUniqueId(UniqueId("P:CXSubscribedPerson"));
    d->addRecord(person);
    EXPECT_TRUE(d->allGroupForRemoteLocation(kBob)->members().empty());
    person->resetWithDictionary({{"First", "Theirs"},
                                 {kCXRemoteLocationProperty, Dictionary{{"labels", Array{kCXSubscribeLabel}},
                                                                        {"values", Array{kBob.str()}},
                                                                        {"identifiers", Array{"i"}}}}},
                                true, false);
    EXPECT_EQ(names(d->allGroupForRemoteLocation(kBob)->members()), (std::vector<std::string>{"Theirs"}));
    d->save();
    EXPECT_EQ(names(d->allGroupForRemoteLocation(kBob)->members()), (std::vector<std::string>{"Theirs"}));
    EXPECT_TRUE(person->isSubscribed());
}

TEST(Subscription, ItsContactsMayBeEditedOnlyWhereThePublisherGrantedWriting) {
    TestDatabase d;
    CXSubscriptionRef bob = CXSubscription::create(kBob, true, "Bob's people");
    d->addRecord(bob);
    CXPersonRef mine = d.addPerson("Mine");
    CXPersonRef theirs = d.addSubscribedPerson("Theirs", kBob.str());
    CXGroupRef group = CXGroup::initWithUniqueId(UniqueId("G:CXSubscribedGroup"));
    group->setValue(TestDatabase::from(kBob.str()), kCXRemoteLocationProperty);
    group->setValue(Value("Friends"), kCXGroupNameProperty);
    d->addRecord(group);
    EXPECT_TRUE(mine->isWritable());
    EXPECT_EQ(mine->readOnlyReason(), "");
    EXPECT_TRUE(d->allGroup()->isWritable());
    EXPECT_TRUE(d->subscriptions()[0]->isWritable()) << "the built-in one stands for the owner's own data";
    for (const CXRecordRef& copy : std::vector<CXRecordRef>{theirs, group, d->allGroupForRemoteLocation(kBob), bob})
        EXPECT_FALSE(copy->isWritable()) << copy->description();
    EXPECT_EQ(theirs->readOnlyReason(),
              "\"Theirs\" came by the subscription to http://store.example/bob/Contacts, which may be read but not "
              "changed. Ask its publisher for the right to write, or make a copy of your own.");
    EXPECT_EQ(group->readOnlyReason().substr(0, 9), "\"Friends\"");

    CXMutableMultiValue self;
    self.addValue("<self>", "<self>");
    d->allGroupForRemoteLocation(kBob)->setValue(CXMultiValue(self), kCXReadWriteSharingACLProperty);
    for (const CXRecordRef& copy : std::vector<CXRecordRef>{theirs, group, d->allGroupForRemoteLocation(kBob), bob}) {
        EXPECT_TRUE(copy->isWritable()) << copy->description();
        EXPECT_EQ(copy->readOnlyReason(), "");
    }
}

TEST(Subscription, ACopyThatIsLeftOverFromOneMayNotBeEdited) {
    TestDatabase d;
    CXPersonRef orphan = d.addSubscribedPerson("Orphan", kBob.str());
    EXPECT_FALSE(orphan->isWritable()) << "nobody is there who could have granted it";
    orphan->removeValueForProperty(kCXRemoteLocationProperty);
    EXPECT_FALSE(orphan->isWritable());
    EXPECT_NE(orphan->readOnlyReason().find("no subscription any more"), std::string::npos);
}

} // namespace
} // namespace rolvane::test
