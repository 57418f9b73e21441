#include "CaptureWorld.h"

using namespace rolvane;
using namespace rolvane::test;

namespace {

class LiveChange : public CaptureWorld {
public:
    std::string uid(const CXRecordRef& record) { return record->sharingUniqueId().str(); }
    Texts linesAfter(const Notification& notification) { return lines(after(notification)); }
};

const Texts kAsked{"updateStateAndExitIfNeeded", "checkCXShareCount"};

Texts asked(const char* last) {
    Texts all = kAsked;
    all.emplace_back(last);
    return all;
}

} // namespace

TEST_F(LiveChange, OfTheDaemonItselfDoesNothingButUpdateTheState) {
    publishAll();
    const auto ada = person("Ada");
    EXPECT_EQ(linesAfter(changed({ada->uniqueId()}, {}, {}, /*sender*/ 1)), Texts{});
    EXPECT_EQ(engine.takeCalls(), Texts{"updateStateAndExitIfNeeded"});
}

TEST_F(LiveChange, ThatYieldsRecordsIsHandedToTheEngineAtOnce) {
    publishAll();
    const auto ada = person("Ada");
    EXPECT_EQ(linesAfter(changed({ada->uniqueId()}, {}, {})),
              (Texts{"1 <self> " + uid(ada) + " - 4", "5 <self> " + uid(ada) + " AllCXGroup 4"}));
    EXPECT_EQ(engine.takeCalls(), asked("applyChangeRecords"));
}

TEST_F(LiveChange, ThatYieldsNothingStillWritesThePreferences) {
    EXPECT_EQ(linesAfter(changed({person("Ada")->uniqueId()}, {}, {})), Texts{});
    EXPECT_EQ(engine.takeCalls(), asked("syncPrefs"));
    EXPECT_EQ(linesAfter(changed({}, {}, {})), Texts{});
    EXPECT_EQ(engine.takeCalls(), asked("syncPrefs"));
}

TEST_F(LiveChange, KeepsTheOrderInsertedUpdatedDeleted) {
    publishAll();
    const auto ada = person("Ada"), eve = person("Eve");
    engine.priorState("CXDCX").set("<self>",
                                   Dictionary{{"G:CXGroup", Dictionary{{"memberUIDState", Array{"gone:CXPerson"}}}}});
    EXPECT_EQ(linesAfter(changed({ada->uniqueId()}, {eve->uniqueId()}, {UniqueId("gone:CXPerson")})),
              (Texts{"1 <self> " + uid(ada) + " - 4", "5 <self> " + uid(ada) + " AllCXGroup 4",
                     "1 <self> " + uid(eve) + " - 4", "258 <self> gone:CXPerson G:CXGroup 4",
                     "257 <self> gone:CXPerson G:CXGroup 4"}));
}

TEST_F(LiveChange, OfAGroupComparesIt) {
    publishAll();
    const auto friends = group("F");
    const Texts expected{"2 <self> - " + uid(friends) + " 4", "6 <self> " + uid(friends) + " AllCXGroup 4",
                         "4 <self> - " + uid(friends) + " 4"};
    EXPECT_EQ(linesAfter(changed({friends->uniqueId()}, {}, {})), expected);
    EXPECT_EQ(linesAfter(changed({}, {friends->uniqueId()}, {})), expected);
}

TEST_F(LiveChange, OfAGroupsContentsComparesTheGroup) {
    publishAll();
    const auto ada = person("Ada");
    const auto friends = group("F");
    knows(kSelf, friends);
    friends->addMember(ada);
    save();
    const UniqueId contents = cxUIDWithTableName(friends->uniqueId(), "CXGroupContents");
    EXPECT_EQ(linesAfter(changed({}, {contents}, {})),
              (Texts{"1 <self> " + uid(ada) + " - 4", "9 <self> " + uid(ada) + " " + uid(friends) + " 4",
                     "5 <self> " + uid(ada) + " " + uid(friends) + " 4",
                     "9 <self> " + uid(ada) + " " + uid(friends) + " 4"}));
    EXPECT_EQ(linesAfter(changed({contents}, {}, {})), Texts{}) << "contents are never inserted";
}

TEST_F(LiveChange, OfTheDatabasesOwnInformationComparesTheAllContactsGroup) {
    publishAll();
    save();
    knows(kSelf, database.allGroup());
    database.allGroup()->setValue(principals({"bob"}), kCXReadSharingACLProperty);
    save();
    const UniqueId info(database.databaseIdentity() + ":CXInfo");
    ASSERT_NE(database.recordForUniqueId(info), nullptr);
    EXPECT_EQ(linesAfter(changed({}, {info}, {})), Texts{"7 <self> - AllCXGroup 4"});
}

TEST_F(LiveChange, OfUnknownRecordsIsSkipped) {
    publishAll();
    EXPECT_EQ(linesAfter(changed({UniqueId("none:CXPerson"), UniqueId("none")}, {UniqueId("none:CXGroup")},
                                 {UniqueId("none:CXSubscriptionRecord"), UniqueId("none:CXInfo")})),
              Texts{});
    const auto subscription = subscribe();
    EXPECT_EQ(linesAfter(changed({subscription->uniqueId()}, {subscription->uniqueId()}, {})), Texts{});
}

TEST_F(LiveChange, OfADeletedRecordIsSearchedUnderItsNormalisedIdentifier) {
    engine.priorState("CXDCX").set(
        "bob",
        Dictionary{{"AllCXGroup", Dictionary{{"memberUIDState", Array{"P:CXPerson"}}}}, {"G:CXGroup", Dictionary()}});
    EXPECT_EQ(linesAfter(changed({}, {}, {UniqueId("P:CXSubscribedPerson"), UniqueId("G:CXSubscribedGroup")})),
              (Texts{"260 bob P:CXPerson - 4", "257 bob P:CXPerson AllCXGroup 4", "258 bob P:CXPerson AllCXGroup 4",
                     "261 bob - G:CXGroup 4"}));
}

// It has left the owner's groups with the deletion. A copy has not been in anything of the owner's that says so.
TEST_F(LiveChange, OfADeletedRecordThatIsHereAgainComparesTheOwnersGroupsThatListedIt) {
    publishAll();
    const auto ada = person("Ada", "A"), eve = person("Eve", "E"), bobs = subscribedPerson("Sub", "S");
    const auto inner = group("I", {}, "I");
    const auto friends = group("F", {ada, eve}, "F"), others = group("O", {ada}, "O"),
               theirs = subscribedGroup("T", "T");
    others->addSubgroup(inner);
    save();
    for (const auto& each : {friends, others, inner}) knows(UserName("<self>"), each);
    engine.priorState("CXDCX").dictionaryFor("bob").set(
        "T:CXGroup", Dictionary{{"memberUIDState", Array{"A:CXPerson", "S:CXPerson"}}});
    friends->removeMember(ada);
    save();
    EXPECT_EQ(linesAfter(changed({}, {}, {ada->uniqueId()})),
              (Texts{"258 <self> A:CXPerson F:CXGroup 4", "257 <self> A:CXPerson F:CXGroup 4"}));
    others->removeSubgroup(inner);
    save();
    EXPECT_EQ(linesAfter(changed({}, {}, {inner->uniqueId()})), Texts{"259 <self> I:CXGroup O:CXGroup 4"});
    EXPECT_EQ(linesAfter(changed({}, {}, {bobs->uniqueId()})), Texts{});
}

TEST_F(LiveChange, OfARecordThatWasRemovedAndMadeAnewInOneSaveComparesTheGroupsThatListedIt) {
    publishAll();
    const auto ada = person("Ada", "A");
    const auto inner = group("I", {}, "I"), friends = group("F", {ada}, "F");
    friends->addSubgroup(inner);
    save();
    for (const CXGroupRef& each : {friends, inner, CXGroupRef(database.allGroup())}) knows(UserName("<self>"), each);
    database.removeRecord(ada);
    database.removeRecord(inner);
    const auto again = person("Ada again", "A");
    const auto innerAgain = group("I", {}, "I");
    save();
    EXPECT_EQ(linesAfter(changed({again->uniqueId()}, {}, {})),
              (Texts{"1 <self> A:CXPerson - 4", "5 <self> A:CXPerson AllCXGroup 4", "258 <self> A:CXPerson F:CXGroup 4",
                     "257 <self> A:CXPerson F:CXGroup 4", "259 <self> I:CXGroup F:CXGroup 4"}));
    EXPECT_EQ(linesAfter(changed({innerAgain->uniqueId()}, {}, {})).back(), "259 <self> I:CXGroup F:CXGroup 4");
}

TEST_F(LiveChange, ThatDeletesManyRecordsIsWhatTheSingleSearchesGive) {
    Array members;
    Notification notification = changed({}, {}, {});
    Array deleted;
    Texts expected;
    for (int i = 0; i < 40; ++i) {
        const std::string member = std::to_string(i) + ":CXPerson";
        members.append(member);
        if (i % 2) continue;
        deleted.append(member);
        expected.push_back("258 <self> " + member + " G:CXGroup 4");
        expected.push_back("257 <self> " + member + " G:CXGroup 4");
    }
    engine.priorState("CXDCX").set("<self>", Dictionary{{"G:CXGroup", Dictionary{{"memberUIDState", members}}}});
    notification.userInfo.set(kCXDeletedRecords, deleted);
    EXPECT_EQ(linesAfter(notification), expected);
}

// Unsubscribing deletes the subscription, its people and its groups in one save: nothing of it may be carried to the
// publisher's store.
TEST_F(LiveChange, OfADeletedSubscriptionRevokesItBeforeAnythingIsSearched) {
    engine.subscriptionMap[UniqueId("S:CXSubscriptionRecord")] = kBobsLocation;
    Dictionary prior = engine.priorState("CXDCX");
    prior.set("bob", Dictionary{{"AllCXGroup", Dictionary{{"memberUIDState", Array{"P:CXPerson"}}}}});
    struct Forgetting : FakeEngine {
        void revokeRemoteLocation(const RemoteLocation& location,
                                  const std::optional<UniqueId>& subscription) override {
            FakeEngine::revokeRemoteLocation(location, subscription);
            priorState("CXDCX").remove("bob");
        }
    } forgetting;
    forgetting.data = engine.data;
    forgetting.subscriptionMap = engine.subscriptionMap;
    conduit.reset();
    CXDCXConduit other(forgetting, {database, preferences, clock, center, 1});
    center.post(changed({}, {}, {UniqueId("P:CXSubscribedPerson"), UniqueId("S:CXSubscriptionRecord")}));
    EXPECT_EQ(forgetting.takeCalls(),
              (Texts{"updateStateAndExitIfNeeded", "checkCXShareCount",
                     "revoke http://store.example/bob/Contacts S:CXSubscriptionRecord", "syncPrefs"}));
}

TEST_F(LiveChange, OfASubscriptionThatTheEngineDoesNotKnowRevokesNothing) {
    EXPECT_EQ(linesAfter(changed({}, {}, {UniqueId("S:CXSubscriptionRecord")})), Texts{});
    EXPECT_EQ(engine.takeCalls(), asked("syncPrefs"));
}

TEST_F(LiveChange, IsNotHeardAnyMoreWhenTheConduitIsGone) {
    conduit.reset();
    center.post(changed({}, {}, {}));
    EXPECT_EQ(engine.takeCalls(), Texts{});
}
