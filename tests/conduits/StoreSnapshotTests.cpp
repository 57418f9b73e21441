#include "conduits/CXDConduit.h"

#include "CaptureWorld.h"
#include "contacts/records/CXMultiValue.h"
#include "foundation/CXException.h"
#include "store/files/CXFileManager.h"
#include "support/CapturingLog.h"

#include <gtest/gtest.h>
#include <set>

using namespace rolvane;
using namespace rolvane::test;

namespace {

// Files in memory, and what was asked of them.
struct MemoryFiles : CXFileManager {
    std::optional<Dictionary> dictionaryAtURL(const Url& url, int* code, bool securely) override {
        asked.push_back(url.absoluteString() + (securely ? " securely" : ""));
        const auto found = files.find(url.absoluteString());
        if (code)
            *code = codes.count(url.absoluteString()) ? codes[url.absoluteString()] : found == files.end() ? 404 : 200;
        if (found == files.end() || codes.count(url.absoluteString())) return std::nullopt;
        return found->second;
    }
    std::optional<FileListing> infoForFilesInContainer(const Url& url) override {
        asked.push_back("list " + url.absoluteString());
        const auto found = listings.find(url.absoluteString());
        return found == listings.end() ? std::nullopt : std::optional(found->second);
    }
    void expectReads(const std::vector<Url>& urls, bool) override {
        std::string names;
        for (const Url& url : urls) names += (names.empty() ? "" : " ") + url.cxLastComponent();
        expected.push_back(names);
    }
    Texts expected; // what was to be fetched ahead, call by call
    std::map<std::string, Dictionary> files;
    std::map<std::string, int> codes; // failures
    std::map<std::string, FileListing> listings;
    Texts asked;
};

struct ListManager : CXACLManager {
    using CXACLManager::CXACLManager;
};

class StoreConduit : public CXDConduit {
public:
    StoreConduit(ConduitEngine& engine, CXRolvane& database, Preferences& preferences)
        : CXDConduit(engine), _database(database), _preferences(preferences) {}
    std::optional<std::string> conduitID() const override { return "CXDVaultra"; }
    int32_t conduitSource() const override { return CXDSyncSourceVaultra; }
    std::optional<UserName> realUserFromUser(const std::optional<UserName>& user) const override {
        return user == kSelf ? UserName("ada") : user;
    }
    CXFileManager* defaultManager() const override { return hasFiles ? &files : nullptr; }
    std::optional<Url> baseLocationForUser(const std::optional<UserName>& user) const override {
        if (!user) return std::nullopt;
        return Url("http://store.example/" + Url::percentEncodeComponent(user->str()) + "/Contacts");
    }
    std::shared_ptr<CXACLManager> ACLManagerForRemoteLocation(const Url& location) override {
        if (auto known = CXDConduit::ACLManagerForRemoteLocation(location)) return known;
        const Url base = *baseLocationForRemoteLocation(location);
        return (*_ACLManagerMap)[base.absoluteString()] = std::make_shared<ListManager>(base, engine());
    }
    void setLastSyncDate(std::optional<Date> date) { _lastSyncDate = date; }

    mutable MemoryFiles files;
    bool hasFiles = true;

protected:
    CXRolvane& database() const override { return _database; }
    Preferences& preferences() const override { return _preferences; }

private:
    CXRolvane& _database;
    Preferences& _preferences;
};

const std::string kBob = "http://store.example/bob/Contacts";
const std::string kAda = "http://store.example/ada/Contacts";

class StoreSnapshot : public CaptureWorld {
protected:
    StoreSnapshot() { conduit.setLastSyncDate(kSync); }

    // Gives the user a store with contacts (all of the same date) and groups.
    void publish(const std::string& base, std::initializer_list<const char*> contacts,
                 std::initializer_list<std::pair<const char*, Dictionary>> groups = {}) {
        conduit.files.files[base + "/info"] = Dictionary{{"SerialNumber", "one"}};
        FileListing listing;
        const std::string path = Url(base).path();
        listing[path + "/info"] = {"info", kSync, 0, {}, false};
        listing[path + "/dateFile"] = {"dateFile", kSync, 0, {}, false};
        listing[path + "/People"] = {"People", kSync, 0, {}, true};
        for (const char* contact : contacts)
            listing[path + "/People/1/" + contact] = {contact, kSync.addingSeconds(10), 0, {}, false};
        for (const auto& [name, state] : groups) {
            listing[path + "/" + name] = {name, kSync, 0, {}, false};
            conduit.files.files[Url(base).cxURLByAppendingComponent(name).absoluteString()] = state;
        }
        conduit.files.listings[base] = listing;
    }
    std::optional<Dictionary> fetch(bool* forbidden = nullptr) {
        return conduit.fetchWorkingStateForSubscription(Url(kBob), forbidden);
    }
    static Dictionary people(const Dictionary& state) {
        return state["People"].dictionary()["memberUIDState"].dictionary();
    }
    FileListing& bobsListing() { return conduit.files.listings[kBob]; }
    size_t count(const RemoteLocation& location) { return database.countPeople(location); }

    static constexpr Date kSync{1'800'000'000};
    StoreConduit conduit{engine, database, preferences};
    CapturingLog log;
};

} // namespace

// -- the working state

TEST_F(StoreSnapshot, AWorkingStateHasTheSerialNumberThePeopleAndTheGroupsWithTheirFiles) {
    publish(kBob, {"a:CXPerson"}, {{"G:CXGroup", {{"memberUIDState", Array{"a:CXPerson"}}, {"else", 1}}}});
    bool forbidden = true;
    const auto state = fetch(&forbidden);
    ASSERT_TRUE(state);
    EXPECT_FALSE(forbidden);
    EXPECT_EQ(Value(*state),
              Value(Dictionary{
                  {"SerialNumber", "one"},
                  {"People",
                   Dictionary{{"memberUIDState",
                               Dictionary{{"a:CXPerson", Dictionary{{"modificationdate", kSync.addingSeconds(10)}}}}}}},
                  {"G:CXGroup",
                   Dictionary{{"modificationdate", kSync}, {"memberUIDState", Array{"a:CXPerson"}}, {"else", 1}}}}));
    EXPECT_EQ(conduit.files.asked, (Texts{kBob + "/info", "list " + kBob, kBob + "/G%3ACXGroup"}));
}

TEST_F(StoreSnapshot, AnEntryWithoutADisplayNameUsesTheLastComponentOfItsKey) {
    publish(kBob, {});
    bobsListing()["/bob/Contacts/People/7/k:CXPerson"] = {"", kSync, 0, {}, false};
    EXPECT_EQ(people(*fetch()).allKeys(), Texts{"k:CXPerson"});
}

TEST_F(StoreSnapshot, AGroupFileWithoutADateYieldsAnEmptyStateAndIsNotRead) {
    publish(kBob, {}, {{"G:CXGroup", {{"memberUIDState", Array{"a"}}}}});
    bobsListing()["/bob/Contacts/G:CXGroup"].modificationdate.reset();
    EXPECT_EQ((*fetch())["G:CXGroup"], Value(Dictionary()));
    EXPECT_EQ(conduit.files.asked, (Texts{kBob + "/info", "list " + kBob}));
}

TEST_F(StoreSnapshot, TheGroupsThatHaveToBeReadAreFetchedAheadTogether) {
    publish(kBob, {"a:CXPerson"}, {{"G:CXGroup", {}}, {"H:CXGroup", {}}, {"I:CXGroup", {}}, {"J:CXGroup", {}}});
    bobsListing()["/bob/Contacts/H:CXGroup"].seen = true;
    bobsListing()["/bob/Contacts/I:CXGroup"].size = 5u << 20; // alone, when it is its turn
    ASSERT_TRUE(fetch());
    EXPECT_EQ(conduit.files.expected, (Texts{"G:CXGroup J:CXGroup", ""}));
    conduit.files.expected.clear();
    conduit.files.codes[kBob + "/G%3ACXGroup"] = 500;
    EXPECT_FALSE(fetch());
    EXPECT_EQ(conduit.files.expected, (Texts{"G:CXGroup J:CXGroup", ""})) << "nothing is fetched for nobody";
}

TEST_F(StoreSnapshot, AContactFileWithoutADateDoesNotAppear) {
    publish(kBob, {"a:CXPerson", "b:CXPerson"});
    bobsListing()["/bob/Contacts/People/1/a:CXPerson"].modificationdate.reset();
    EXPECT_EQ(people(*fetch()).allKeys(), Texts{"b:CXPerson"});
}

TEST_F(StoreSnapshot, SpecialFilesAndOtherNamesAreNoRecords) {
    publish(kBob, {});
    bobsListing()["/bob/Contacts/notes.txt"] = {"notes.txt", kSync, 0, {}, false};
    bobsListing()["/bob/Contacts/Contacts"] = {"Contacts", kSync, 0, {}, false};
    EXPECT_EQ(fetch()->allKeys(), (Texts{"People", "SerialNumber"}));
    EXPECT_TRUE(log.lines().empty()) << log.text();
}

TEST_F(StoreSnapshot, ForbiddenAndMissingInformationSetTheFlagAndGiveNothing) {
    publish(kBob, {"a:CXPerson"});
    for (const int code : {403, 404}) {
        conduit.files.codes[kBob + "/info"] = code;
        bool forbidden = false;
        EXPECT_FALSE(fetch(&forbidden)) << code;
        EXPECT_TRUE(forbidden) << code;
        EXPECT_TRUE(fetch()) << "without a flag the status is ignored: " << code;
    }
}

TEST_F(StoreSnapshot, AnyOtherFailureToReadTheInformationLeavesTheSerialNumberOut) {
    publish(kBob, {"a:CXPerson"});
    for (const int code : {0, 401, 500, 503, 200}) {
        conduit.files.codes[kBob + "/info"] = code;
        bool forbidden = true;
        const auto state = fetch(&forbidden);
        ASSERT_TRUE(state) << code;
        EXPECT_FALSE(forbidden) << code;
        EXPECT_FALSE(state->contains("SerialNumber")) << code;
        EXPECT_TRUE(conduit.comparePriorStateToCurrentState({}, Dictionary{{"bob", *state}}).empty()) << code;
    }
}

TEST_F(StoreSnapshot, AFailedListingGivesNothingAndIsLogged) {
    publish(kBob, {"a:CXPerson"});
    conduit.files.listings.clear();
    EXPECT_FALSE(fetch());
    EXPECT_EQ(log.lines(), Texts{"Could not retrieve info for files in subscription: " + kBob});
}

TEST_F(StoreSnapshot, AGroupFileThatCannotBeReadGivesNothingOfTheWholeUserAndIsLogged) {
    publish(kBob, {"a:CXPerson"}, {{"G:CXGroup", {}}, {"H:CXGroup", {}}});
    conduit.files.codes[kBob + "/G%3ACXGroup"] = 500;
    EXPECT_FALSE(fetch());
    EXPECT_EQ(log.lines(), Texts{"Could not get group info at: " + kBob + "/G%3ACXGroup, error: 500"});
}

TEST_F(StoreSnapshot, EntriesWithHostileNamesAreLeftOutWithOneLineEachAndTheRestGoesOn) {
    publish(kBob, {"a:CXPerson", "A:CXPerson"});
    const Texts hostile{"../../x:CXPerson", "x\x01y:CXPerson", std::string(10240, 'x') + ":CXPerson", ".:CXPerson",
                        "x\xff:CXGroup"};
    for (size_t i = 0; i < hostile.size(); ++i)
        bobsListing()["/bob/Contacts/People/2/" + std::to_string(i)] = {hostile[i], kSync, 0, {}, false};
    const auto state = fetch();
    ASSERT_TRUE(state);
    EXPECT_EQ(people(*state).allKeys(), (Texts{"A:CXPerson", "a:CXPerson"})) << "twins but for letter case are two";
    EXPECT_EQ(log.lines().size(), hostile.size());
    for (const std::string& each : log.lines()) {
        EXPECT_TRUE(each.starts_with("An entry with a strange name in " + kBob)) << each;
        EXPECT_LT(each.size(), 400u);
        EXPECT_EQ(each.find('\x01'), std::string::npos);
    }
}

TEST_F(StoreSnapshot, AFileAmongTheContactsThatIsCalledLikeAGroupHidesNobody) {
    publish(kBob, {"a:CXPerson"}, {{"G:CXGroup", Dictionary{{"memberUIDState", Array{"a:CXPerson"}}}}});
    bobsListing()["/bob/Contacts/People/2/stray:CXGroup"] = {"stray:CXGroup", kSync, 0, {}, false};
    const auto state = fetch();
    ASSERT_TRUE(state) << log.text();
    EXPECT_EQ(people(*state).allKeys(), Texts{"a:CXPerson"});
    EXPECT_TRUE(state->contains("G:CXGroup"));
    EXPECT_FALSE(state->contains("stray:CXGroup"));
    EXPECT_TRUE(log.mentions("An entry with a strange name in " + kBob)) << log.text();
}

// -- the snapshot of everybody

TEST_F(StoreSnapshot, ReadsTheOwnersOwnPublicationFirstWhenSomethingIsKnownOfItAndThenTheSubscriptions) {
    publish(kBob, {"a:CXPerson"});
    publish(kAda, {"b:CXPerson"});
    const auto subscription = subscribe();
    save();
    EXPECT_EQ(conduit.currentState().allKeys(), Texts{"bob"}) << "nothing is known of an own publication";
    engine.priorState("CXDVaultra").set("<self>", Dictionary());
    conduit.files.asked.clear();
    EXPECT_EQ(conduit.currentState().allKeys(), (Texts{"<self>", "bob"}));
    EXPECT_EQ(conduit.files.asked, (Texts{kAda + "/info", "list " + kAda, kBob + "/info", "list " + kBob}));
    EXPECT_EQ(engine.remoteLocationForSubscriptionUID(subscription->uniqueId()), RemoteLocation(kBob));
}

TEST_F(StoreSnapshot, SubscriptionsOfOtherSourcesAndTheLocalOneAreNotRead) {
    subscribe(RemoteLocation("file:/usr/share/rolvane/bob"));
    save();
    EXPECT_TRUE(conduit.currentState().empty());
    EXPECT_TRUE(conduit.files.asked.empty());
    EXPECT_TRUE(engine.subscriptionMap.empty());
}

TEST_F(StoreSnapshot, TwoSubscriptionsToOneUserAreReadOnce) {
    publish(kBob, {});
    subscribe();
    subscribe(RemoteLocation("http://other.example/bob/Contacts"));
    save();
    conduit.currentState();
    EXPECT_EQ(conduit.files.asked, (Texts{kBob + "/info", "list " + kBob}));
}

TEST_F(StoreSnapshot, ALocationThatNamesNobodyIsNotRead) {
    subscribe(RemoteLocation("http://store.example/"));
    save();
    EXPECT_TRUE(conduit.currentState().empty());
    EXPECT_TRUE(conduit.files.asked.empty());
}

TEST_F(StoreSnapshot, AStoreWithoutAListOfEverybodyGetsOneOfTheContactsThatLieThere) {
    publish(kBob, {"b:CXPerson", "a:CXPerson"});
    subscribe();
    save();
    EXPECT_EQ(conduit.currentState()["bob"].dictionary()["AllCXGroup"],
              Value(Dictionary{{"memberUIDState", Array{"a:CXPerson", "b:CXPerson"}}}));
    publish(kBob, {"b:CXPerson"}, {{"AllCXGroup", {{"memberUIDState", Array{"c:CXPerson"}}}}});
    EXPECT_EQ(conduit.currentState()["bob"].dictionary()["AllCXGroup"].dictionary()["memberUIDState"],
              Value(Array{"c:CXPerson"}));
}

TEST_F(StoreSnapshot, AForbiddenSubscriptionIsRevokedAndItsCopiesLeaveInOneSave) {
    const auto subscription = subscribe();
    subscribedPerson("Cleo", "c");
    subscribedGroup("Friends", "G");
    person("Own", "o");
    save();
    const int64_t before = database.journalPosition();
    conduit.files.codes[kBob + "/info"] = 403;
    EXPECT_TRUE(conduit.currentState().empty());
    EXPECT_EQ(engine.takeCalls(), Texts{"revoke " + kBob + " " + subscription->uniqueId().str()});
    EXPECT_EQ(count(kBobsLocation), 0u);
    EXPECT_FALSE(database.recordForUniqueId(UniqueId("G:CXSubscribedGroup")));
    EXPECT_EQ(database.subscriptions().size(), 1u);
    EXPECT_EQ(database.listPeople(RemoteLocation(""), "").size(), 1u) << "the owner's own stay";
    std::set<Date> saves;
    for (const auto& entry : database.journalEntries(before)) saves.insert(entry.date);
    EXPECT_EQ(saves.size(), 1u);
}

TEST_F(StoreSnapshot, AStoreThatCannotBeReadHasNoEntryAndNothingIsRevoked) {
    publish(kBob, {"a:CXPerson"});
    conduit.files.listings.clear();
    subscribe();
    save();
    EXPECT_TRUE(conduit.currentState().empty());
    EXPECT_TRUE(engine.takeCalls().empty());
    EXPECT_EQ(database.subscriptions().size(), 2u);
}

TEST_F(StoreSnapshot, TheOwnersTreeThatIsGoneEndsThePublicationAndRemovesNoContact) {
    publishAll();
    person("Own", "o");
    save();
    engine.priorState("CXDVaultra").set("<self>", Dictionary());
    EXPECT_TRUE(conduit.currentState().empty());
    EXPECT_EQ(engine.takeCalls(), Texts{"revoke " + kAda + " -"});
    EXPECT_FALSE(database.allGroup()->valueForProperty(kCXRemoteLocationProperty));
    EXPECT_EQ(count(RemoteLocation("")), 1u);
    EXPECT_FALSE(database.hasUnsavedChanges());
}

TEST_F(StoreSnapshot, ASourceThatHasNoFilesToReadRevokesNothing) {
    publish(kBob, {"a:CXPerson"});
    subscribe();
    subscribedPerson("Cleo", "c");
    save();
    conduit.hasFiles = false;
    EXPECT_TRUE(conduit.currentState().empty());
    EXPECT_TRUE(engine.takeCalls().empty());
    EXPECT_EQ(count(kBobsLocation), 1u);
}

TEST_F(StoreSnapshot, SynchronisesTheContactApplicationsPreferencesBeforeItReadsTheSubscriptions) {
    preferences.set(kApplicationDomain, "Mark", 1);
    conduit.currentState();
    EXPECT_EQ(Preferences(preferences.path()).get(kApplicationDomain, "Mark"), Value(1));
}

// -- the comparison of everybody

TEST_F(StoreSnapshot, TheFirstPassOverASubscriptionTakesEverybodyWithTheirContentLeftInTheStore) {
    publish(kBob, {"a:CXPerson"}, {{"AllCXGroup", {{"memberUIDState", Array{"a:CXPerson"}}}}});
    subscribe();
    save();
    const CXDChangeRecords records = conduit.changeRecords();
    EXPECT_EQ(lines(records),
              (Texts{"1 bob a:CXSubscribedPerson - 1", "2 bob - AllCXSubscribedGroup 1",
                     "1 bob a:CXSubscribedPerson - 1", "5 bob a:CXSubscribedPerson AllCXSubscribedGroup 1"}));
    for (const auto& record : records) EXPECT_EQ(record->initialSource(), CXDSyncSourceVaultra);
    const std::string file = conduit.locationForUID(UniqueId("a:CXPerson"), UserName("bob"))->absoluteString();
    conduit.files.files[file] = Dictionary{{"First", "Cleo"}, {"RemoteLocation", "bad"}};
    conduit.files.asked.clear();
    const Dictionary content = records[0]->payload().dictionary();
    EXPECT_EQ(conduit.files.asked, Texts{file + " securely"});
    EXPECT_EQ(content["First"], Value("Cleo"));
    EXPECT_EQ(CXMultiValue::fromValue(content[kCXRemoteLocationProperty])->valueAtIndex(0), Value(kBob));
}

TEST_F(StoreSnapshot, TheOwnersOwnContactsComeBackUnderTheirOwnIdentifiersWithoutAStamp) {
    publish(kAda, {"a:CXPerson"});
    engine.priorState("CXDVaultra")
        .set("<self>", Dictionary{{"AllCXGroup", Dictionary{{"memberUIDState", Array{"a:CXPerson"}}}}});
    const CXDChangeRecords records = conduit.changeRecords();
    ASSERT_EQ(lines(records), Texts{"1 <self> a:CXPerson - 1"});
    EXPECT_EQ(records[0]->inMemoryPayload(), Value(Dictionary()));
}

TEST_F(StoreSnapshot, TheCurrentSerialNumberIsWrittenIntoThePriorStateOfAKnownUserOnly) {
    publish(kBob, {});
    subscribe();
    save();
    conduit.changeRecords();
    EXPECT_FALSE(engine.priorState("CXDVaultra").contains("bob"))
        << "a new user gets an entry when records are applied";
    engine.priorState("CXDVaultra").set("bob", Dictionary());
    conduit.changeRecords();
    EXPECT_EQ(engine.priorState("CXDVaultra")["bob"].dictionary()["SerialNumber"], Value("one"));
}

TEST_F(StoreSnapshot, AnotherSerialNumberGivesNoRecordsAndCancelsTheSharingOnce) {
    publish(kBob, {"a:CXPerson"}, {{"G:CXGroup", {}}});
    const auto subscription = subscribe();
    subscribedPerson("Cleo", "a");
    save();
    engine.priorState("CXDVaultra").set("bob", Dictionary{{"SerialNumber", "another"}});
    EXPECT_TRUE(conduit.changeRecords().empty());
    EXPECT_EQ(engine.takeCalls(), Texts{"revoke " + kBob + " " + subscription->uniqueId().str()});
    EXPECT_EQ(count(kBobsLocation), 0u);
    EXPECT_EQ(database.subscriptions().size(), 1u);
}

TEST_F(StoreSnapshot, AnotherSerialNumberOfTheOwnersTreeEndsThePublicationAndRemovesNoContact) {
    publish(kAda, {"a:CXPerson"}, {{"G:CXGroup", {}}});
    publishAll();
    person("Own", "o");
    save();
    engine.priorState("CXDVaultra").set("<self>", Dictionary{{"SerialNumber", "another"}});
    EXPECT_TRUE(conduit.changeRecords().empty());
    EXPECT_EQ(engine.takeCalls(), Texts{"revoke http://store.example/%3Cself%3E/Contacts -"})
        << "under the user as it stands";
    EXPECT_EQ(engine.userForRemoteLocation(engine.revoked.front()), kSelf);
    EXPECT_FALSE(database.allGroup()->valueForProperty(kCXRemoteLocationProperty));
    EXPECT_EQ(count(RemoteLocation("")), 1u);
    EXPECT_FALSE(database.hasUnsavedChanges());
}

TEST_F(StoreSnapshot, AUserOnlyInThePriorStateIsSkipped) {
    engine.priorState("CXDVaultra")
        .set("bob", Dictionary{{"G:CXGroup", Dictionary{{"memberUIDState", Array{"a:CXPerson"}}}}});
    EXPECT_TRUE(conduit.changeRecords().empty());
}

TEST_F(StoreSnapshot, UsersAreComparedInTheOrderOfThePriorStateAndThenTheNewOnes) {
    const Dictionary state{{"SerialNumber", "s"}, {"G:CXGroup", Dictionary()}};
    const Dictionary prior{{"mia", Dictionary()}};
    const Dictionary current{{"bob", state}, {"mia", state}, {"zoe", state}};
    EXPECT_EQ(
        lines(conduit.comparePriorStateToCurrentState(prior, current)),
        (Texts{"2 mia - G:CXSubscribedGroup 1", "2 bob - G:CXSubscribedGroup 1", "2 zoe - G:CXSubscribedGroup 1"}));
}

// -- access lists

TEST_F(StoreSnapshot, EqualAccessListsYieldNoRecord) {
    EXPECT_TRUE(conduit.changeRecordsForACLAtRemoteLocation(Url(kBob)).empty());
    conduit.ACLManagerForRemoteLocation(Url(kBob))->grantReadWritePermissionForGUID(UniqueId("AllCXGroup"), {}, kSelf);
    engine.priorState("CXDCX").set("bob", Dictionary{{"AllCXGroup", Dictionary{{"ReadWriteSharingACL", Array{"<self>"}},
                                                                               {"ReadSharingACL", Array{"<self>"}}}}});
    EXPECT_TRUE(conduit.changeRecordsForACLAtRemoteLocation(Url(kBob)).empty());
}

TEST_F(StoreSnapshot, APrincipalMovedFromReadToReadWriteYieldsOneRecordOfEachType) {
    conduit.ACLManagerForRemoteLocation(Url(kBob))->grantPrincipal(kSelf, true);
    engine.priorState("CXDCX").set("bob", Dictionary{{"AllCXGroup", Dictionary{{"ReadSharingACL", Array{"<self>"}}}}});
    const auto records = conduit.changeRecordsForACLAtRemoteLocation(Url(kBob));
    ASSERT_EQ(lines(records), (Texts{"8 bob - AllCXGroup 1", "7 bob - AllCXGroup 1"}));
    EXPECT_EQ(records[0]->inMemoryPayload(), Value(Dictionary{{"additions", Array{"<self>"}}, {"deletions", Array()}}));
    EXPECT_EQ(records[1]->inMemoryPayload(), Value(Dictionary{{"additions", Array()}, {"deletions", Array{"<self>"}}}));
    EXPECT_EQ(records[0]->initialSource(), CXDSyncSourceVaultra);
}

TEST_F(StoreSnapshot, TheRecordsOfTheAccessListsComeBeforeThoseOfTheContacts) {
    publish(kBob, {"a:CXPerson"}, {{"AllCXGroup", {}}});
    conduit.ACLManagerForRemoteLocation(Url(kBob))->grantPrincipal(kSelf, true);
    subscribe();
    save();
    const auto records = conduit.changeRecords();
    ASSERT_EQ(lines(records),
              (Texts{"8 bob - AllCXGroup 1", "1 bob a:CXSubscribedPerson - 1", "2 bob - AllCXSubscribedGroup 1"}));
    EXPECT_EQ(records[2]->inMemoryPayload().dictionary()[kCXReadWriteSharingACLProperty], Value("bob"));
}

TEST_F(StoreSnapshot, AnAccessListsDifferenceKeepsTheOrdersAndTakesAnAbsentListAsEmpty) {
    EXPECT_EQ(Value(CXDConduit::compareCurrentACLWithPriorACL(Array{"c", "a"}, Array{"a", "z", "b"})),
              Value(Dictionary{{"additions", Array{"c"}}, {"deletions", Array{"z", "b"}}}));
    EXPECT_EQ(Value(CXDConduit::compareCurrentACLWithPriorACL({}, {})),
              Value(Dictionary{{"additions", Array()}, {"deletions", Array()}}));
}

// -- ending

TEST_F(StoreSnapshot, CancellingAPublicationTakesItsMarksAwayAndForgetsTheOwner) {
    publishAll();
    database.allGroup()->setValue(principals({"bob"}), kCXReadSharingACLProperty);
    database.allGroup()->setValue(principals({"bob"}), kCXReadWriteSharingACLProperty);
    person("Own", "o");
    save();
    conduit.cancelPublishing(RemoteLocation(kAda));
    EXPECT_EQ(engine.takeCalls(), Texts{"revoke " + kAda + " -"});
    for (const char* property : {kCXRemoteLocationProperty, kCXReadWriteSharingACLProperty, kCXReadSharingACLProperty})
        EXPECT_FALSE(database.allGroup()->valueForProperty(property)) << property;
    EXPECT_FALSE(database.hasUnsavedChanges());
    EXPECT_EQ(count(RemoteLocation("")), 1u);
}

TEST_F(StoreSnapshot, CancellingTheSharingToTheOwnersLocationRevokesWithoutASubscriptionAndRemovesNoContacts) {
    publishAll();
    person("Own", "o");
    save();
    conduit.cancelSharingTo(RemoteLocation(kAda));
    EXPECT_EQ(engine.takeCalls(), Texts{"revoke " + kAda + " -"});
    EXPECT_FALSE(database.allGroup()->valueForProperty(kCXRemoteLocationProperty));
    EXPECT_EQ(count(RemoteLocation("")), 1u);
    EXPECT_FALSE(database.hasUnsavedChanges());
}

TEST_F(StoreSnapshot, CancellingTheSharingToSomebodyWithoutASubscriptionHarmsNothing) {
    person("Own", "o");
    save();
    conduit.cancelSharingTo(kBobsLocation);
    EXPECT_EQ(engine.takeCalls(), Texts{"revoke " + kBob + " -"});
    EXPECT_EQ(count(RemoteLocation("")), 1u);
}

TEST_F(StoreSnapshot, TheCopiesOfOtherSubscriptionsStay) {
    const RemoteLocation eves("http://store.example/eve/Contacts");
    subscribe();
    subscribe(eves);
    subscribedPerson("Cleo", "c");
    subscribedPerson("Dora", "d", eves);
    save();
    conduit.removeRecordsAssociateWithRemoteLocation(kBobsLocation);
    EXPECT_EQ(count(kBobsLocation), 0u);
    EXPECT_EQ(count(eves), 1u);
    EXPECT_EQ(database.subscriptions().size(), 2u);
}
