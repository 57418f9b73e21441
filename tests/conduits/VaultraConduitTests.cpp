#include "conduits/store/CXDVaultraConduit.h"

#include "../store/StoreWorld.h"
#include "FakeEngine.h"
#include "TestRecord.h"
#include "conduits/UserAlert.h"
#include "contacts/database/CXRolvane.h"
#include "contacts/database/DaemonMemory.h"
#include "contacts/records/Constants.h"
#include "foundation/Preferences.h"
#include "foundation/PropertyList.h"
#include "store/account/CXNetworkController.h"
#include "support/CapturingLog.h"

#include <atomic>
#include <chrono>
#include <filesystem>
#include <future>
#include <gtest/gtest.h>
#include <thread>

using namespace rolvane;
using namespace rolvane::test;

namespace {

struct SwitchedNetwork : CXNetworkController {
    bool canReachAddress(const std::string& host) override {
        asked.push_back(host);
        return up;
    }
    bool up = true;
    Texts asked;
};

struct RecordedAlert : UserAlert {
    void show(const Text& text) override { shown.push_back(text); }
    void tell(const Text& text) override { told.push_back(text); }
    std::vector<Text> told;
    std::vector<Text> shown;
};

// The conduit over a client of a real store whose requests are seen and may be answered in the store's place.
class VaultraConduit : public testing::Test {
protected:
    // HTTP/1.1: on HTTP/2 libcurl may lose the answer to a refused upload (docs/limits.md), and answers matter here.
    static void SetUpTestSuite() {
        PrivateStoreOptions options;
        options.http2 = false;
        world = new StoreWorld(options);
    }
    static void TearDownTestSuite() {
        delete world;
        world = nullptr;
    }
    VaultraConduit() {
        std::filesystem::remove_all(world->file());
        std::filesystem::remove_all(world->file("", "bob"));
        engine.account = UserName("alice");
        setDebugLevel(1);
        use(std::make_unique<Client>(*world));
    }
    ~VaultraConduit() override { setDebugLevel(0); }

    void use(std::unique_ptr<Client> other) {
        conduit.reset();
        client = std::move(other);
        CXDVaultraConduit::Collaborators parts{client->manager, network,     preferences, clock,
                                               center,          distributed, alert,       database};
        parts.makeACLManager = [this](const Url& base, const LocationOwner& owner) {
            auto manager = std::make_shared<CXACLManager>(base, owner);
            managers.push_back(manager);
            return manager;
        };
        conduit = std::make_unique<CXDVaultraConduit>(engine, std::move(parts));
    }
    void open() {
        conduit->open();
        ASSERT_FALSE(conduit->vaultraOffLine()) << log.text() << client->wire->text();
        client->wire->clear();
        engine.takeCalls();
    }
    static CXDChangeRecordPtr record(int type, const char* person, const char* group, Value payload = {},
                                     const char* user = "<self>") {
        return testRecord(CXDSyncSourceCX, type, person, group, std::move(payload), user);
    }
    bool apply(const CXDChangeRecordPtr& what) {
        denied = true; // whoever answers has to say so
        return conduit->applyChangeRecord(what, &denied);
    }
    Value plist(const std::string& file) { return PropertyList::fromXML(world->contents(file)); }
    void answerEvery(const char* method, int status) {
        client->wire->intercept([=](const HttpRequest& request) {
            return request.method == method ? std::optional(answerOf(status)) : std::nullopt;
        });
    }
    Date storedDate(const char* key) {
        return Preferences(directory / "preferences.db", daemonMemory(directory / "contacts.db"))
            .get(kDaemonDomain, key)
            .date()
            .value_or(Date());
    }

    static StoreWorld* world;
    TempDirectory directory;
    FakeEngine engine;
    SwitchedNetwork network;
    RecordedAlert alert;
    ManualClock clock{Date(1'800'000'000)};
    NotificationCenter center;
    LocalNotifications distributed;
    Preferences preferences{directory / "preferences.db", daemonMemory(directory / "contacts.db")};
    CXRolvane database{CXRolvane::Options{.path = directory / "contacts.db", .program = "RolvaneManager"}};
    CapturingLog log;
    std::vector<std::shared_ptr<CXACLManager>> managers;
    std::unique_ptr<Client> client;
    std::unique_ptr<CXDVaultraConduit> conduit;
    bool denied = false;
};
StoreWorld* VaultraConduit::world = nullptr;

const std::string kLockOfAlice = "lock http://contacts.example.org/alice/Contacts/dateFile";

} // namespace

TEST_F(VaultraConduit, IsTheConduitOfTheNetworkStore) {
    EXPECT_EQ(conduit->conduitID(), "CXDVaultra");
    EXPECT_EQ(conduit->conduitSource(), CXDSyncSourceVaultra);
    EXPECT_EQ(conduit->realUserFromUser(kSelf), UserName("alice"));
    EXPECT_EQ(conduit->realUserFromUser(UserName("bob")), UserName("bob"));
    EXPECT_EQ(conduit->realUserFromUser(std::nullopt), std::nullopt);
    EXPECT_EQ(conduit->baseLocationForUser(UserName("bob"))->absoluteString(),
              "http://contacts.example.org/bob/Contacts");
    EXPECT_EQ(conduit->baseLocationForUser(std::nullopt), std::nullopt);
    EXPECT_EQ(conduit->defaultManager(), &client->manager);
}

// -- a pass's frame

TEST_F(VaultraConduit, OpensAStoreThatAnswersAndMakesItsStructure) {
    conduit->open();
    EXPECT_FALSE(conduit->vaultraOffLine());
    EXPECT_TRUE(log.has("Vaultra is online"));
    EXPECT_EQ(network.asked, Texts{"localhost"});
    EXPECT_TRUE(std::filesystem::is_directory(world->file("People/31")));
    EXPECT_TRUE(std::filesystem::is_regular_file(world->file("dateFile")));
    EXPECT_EQ(conduit->lastSyncDate(), Date::distantPast());
    EXPECT_TRUE(conduit->changeRecords().empty());
}

TEST_F(VaultraConduit, OpensWithTheDateOfTheLastSync) {
    preferences.set(kDaemonDomain, "CXDVaultraConduitLastSyncDate", Date(1'700'000'000));
    conduit->open();
    EXPECT_EQ(conduit->lastSyncDate(), Date(1'700'000'000));
}

TEST_F(VaultraConduit, AnUnreachableAddressIsOfflineAsksNobodyAndNeverTakesThePasswordPath) {
    network.up = false;
    conduit->open();
    EXPECT_TRUE(conduit->vaultraOffLine());
    EXPECT_TRUE(log.has("Vaultra is offline"));
    EXPECT_EQ(client->wire->methods(), "");
    EXPECT_TRUE(alert.shown.empty());
    EXPECT_EQ(engine.takeCalls(), Texts{});
}

TEST_F(VaultraConduit, AStoreThatDoesNotAnswerIsOffline) {
    client->wire->intercept([](const HttpRequest&) {
        HttpResponse none;
        none.error = TransportError::unreachable;
        return std::optional(none);
    });
    conduit->open();
    EXPECT_TRUE(conduit->vaultraOffLine());
    EXPECT_TRUE(alert.shown.empty());
    EXPECT_EQ(engine.takeCalls(), Texts{});
}

TEST_F(VaultraConduit, OfflineNothingIsLockedSentOrDenied) {
    network.up = false;
    conduit->open();
    EXPECT_FALSE(apply(record(CXDUpdateRecord, "P", nullptr, Dictionary())));
    EXPECT_FALSE(denied);
    EXPECT_EQ(engine.takeCalls(), Texts{});
    EXPECT_EQ(client->wire->methods(), "");
}

TEST_F(VaultraConduit, ClosingStoresTheServersDate) {
    open();
    conduit->close();
    const auto server = client->manager.modDateForURL(client->at("dateFile"));
    ASSERT_TRUE(server);
    EXPECT_EQ(conduit->lastSyncDate(), server);
    EXPECT_EQ(storedDate("CXDVaultraConduitLastSyncDate"), *server);
    EXPECT_TRUE(log.has(CXFormat("Closing, last sync: %@", server))) << log.text();
}

TEST_F(VaultraConduit, ClosingOfflineKeepsTheDate) {
    preferences.set(kDaemonDomain, "CXDVaultraConduitLastSyncDate", Date(1'700'000'000));
    preferences.synchronize(kDaemonDomain);
    network.up = false;
    conduit->open();
    conduit->close();
    EXPECT_EQ(storedDate("CXDVaultraConduitLastSyncDate"), Date(1'700'000'000));
    EXPECT_FALSE(log.mentions("Closing"));
}

TEST_F(VaultraConduit, ClosingKeepsTheDateWhenTheStoreWentAwayDuringThePass) {
    preferences.set(kDaemonDomain, "CXDVaultraConduitLastSyncDate", Date(1'700'000'000));
    preferences.synchronize(kDaemonDomain);
    open();
    client->wire->intercept([](const HttpRequest&) { return std::optional(answerOf(500)); });
    conduit->close();
    EXPECT_EQ(storedDate("CXDVaultraConduitLastSyncDate"), Date(1'700'000'000));
}

TEST_F(VaultraConduit, ADateThatWasAskedForInAdvanceIsNotAskedForAgain) {
    open();
    conduit->willClose();
    conduit->willClose();
    conduit->close();
    EXPECT_EQ(client->wire->methods(), "PUT HEAD") << client->wire->text();
    ASSERT_TRUE(conduit->lastSyncDate());
    EXPECT_EQ(conduit->lastSyncDate(), client->manager.modDateForURL(client->at("dateFile")));

    client->wire->clear();
    conduit->close();
    EXPECT_EQ(client->wire->methods(), "PUT HEAD") << "it is good for one pass";
}

TEST_F(VaultraConduit, ADateThatCouldNotBeHadInAdvanceIsAskedForWhenThePassCloses) {
    open();
    client->wire->intercept([](const HttpRequest&) { return std::optional(answerOf(500)); });
    conduit->willClose();
    while (client->wire->count("PROPFIND") == 0) std::this_thread::yield(); // the last that is tried
    client->wire->intercept(nullptr);
    conduit->close();
    EXPECT_EQ(client->wire->methods(), "PUT HEAD PROPFIND PUT HEAD");
    EXPECT_EQ(conduit->lastSyncDate(), client->manager.modDateForURL(client->at("dateFile")));
}

TEST_F(VaultraConduit, WhoeverPublishesAsksForNoDateInAdvance) {
    engine.priorState(kConduitVaultra).dictionaryFor("<self>");
    open();
    conduit->willClose();
    EXPECT_EQ(client->wire->text(), "");
    conduit->close();
    EXPECT_EQ(client->wire->methods(), "PUT HEAD");
}

TEST_F(VaultraConduit, AGatheringGoesOnWhileTheStructureIsMadeAndAChangeWaitsForIt) {
    std::promise<void> opened;
    const auto mayMake = opened.get_future().share();
    std::atomic<bool> inTime{true};
    client->wire->intercept([&, mayMake](const HttpRequest& request) -> std::optional<HttpResponse> {
        if (request.method == "MKCOL" && mayMake.wait_for(std::chrono::seconds(10)) != std::future_status::ready)
            inTime = false;
        return std::nullopt;
    });
    conduit->willGather();
    conduit->open();
    EXPECT_FALSE(conduit->vaultraOffLine());
    opened.set_value();
    EXPECT_TRUE(apply(record(CXDUpdateRecord, "a:CXPerson", nullptr, Dictionary{{"First", "Ada"}})));
    EXPECT_TRUE(inTime) << "opening has waited for the structure";
    EXPECT_TRUE(std::filesystem::is_directory(world->file("People/31")));
    EXPECT_EQ(client->wire->count("PUT"), 3u) << client->wire->text();
}

TEST_F(VaultraConduit, AGatheringFindsATreeThatIsKnownWhole) {
    engine.priorState(kConduitVaultra).dictionaryFor("<self>");
    conduit->willGather();
    conduit->open();
    EXPECT_TRUE(std::filesystem::is_directory(world->file("People/31")));
    EXPECT_TRUE(std::filesystem::is_regular_file(world->file("info")));
}

TEST_F(VaultraConduit, ClosingForgetsRevokedUsers) {
    engine.priorState("CXDVaultra").set("bob", Dictionary());
    engine.revoked = {RemoteLocation("http://contacts.example.org/bob/Contacts")};
    open();
    conduit->close();
    EXPECT_TRUE(engine.priorState("CXDVaultra").empty());
}

TEST_F(VaultraConduit, ClosingOfflineForgetsRevokedUsersToo) {
    engine.priorState("CXDVaultra").set("bob", Dictionary());
    engine.revoked = {RemoteLocation("http://contacts.example.org/bob/Contacts")};
    network.up = false;
    conduit->open();
    conduit->close();
    EXPECT_TRUE(engine.priorState("CXDVaultra").empty());
}

TEST_F(VaultraConduit, TheServersDateIsThatOfTheClockFileItHasJustWritten) {
    open();
    ASSERT_TRUE(conduit->currentServerDate());
    EXPECT_EQ(world->contents("dateFile"), "why");
}

// -- a refused password

TEST_F(VaultraConduit, ARefusedPasswordWarnsThePersonAndEndsTheDaemon) {
    use(std::make_unique<Client>(*world, "alice", "wrong"));
    conduit->open();
    EXPECT_TRUE(log.has("Username or password is incorrect. Displaying visual warning")) << log.text();
    ASSERT_EQ(alert.shown.size(), 1u);
    EXPECT_EQ(alert.shown[0].level, 3);
    EXPECT_EQ(alert.shown[0].icon, "Rolvane");
    EXPECT_EQ(alert.shown[0].defaultButton, "OK");
    EXPECT_FALSE(alert.shown[0].header.empty());
    EXPECT_NE(alert.shown[0].header, alert.shown[0].message);
    EXPECT_EQ(engine.takeCalls(), Texts{"cancel"});
    EXPECT_EQ(storedDate("CXDLastUserPasswordWarningDate"), clock.now());
    EXPECT_TRUE(conduit->vaultraOffLine());
}

TEST_F(VaultraConduit, ASecondRefusalWithin15MinutesShowsNothingAndStillEndsTheDaemon) {
    use(std::make_unique<Client>(*world, "alice", "wrong"));
    conduit->open();
    clock.advance(900);
    conduit->open();
    EXPECT_EQ(alert.shown.size(), 1u);
    EXPECT_TRUE(log.has("Username or password is incorrect. No visual warning"));
    EXPECT_EQ(engine.takeCalls(), (Texts{"cancel", "cancel"}));
    clock.advance(0.5);
    conduit->open();
    EXPECT_EQ(alert.shown.size(), 2u);
}

// -- notifications

TEST_F(VaultraConduit, SomebodyElsesPublicationStartsAPass) {
    distributed.post({"SimulateVaultraNotification", std::nullopt, {}});
    EXPECT_EQ(engine.takeCalls(), Texts{"bringSourcesUpToDate"});
}

TEST_F(VaultraConduit, ManyPublicationsWhileTheDaemonIsSuspendedStartOnePass) {
    distributed.setSuspended(true);
    for (int i = 0; i < 3; ++i) distributed.post({"SimulateVaultraNotification", std::nullopt, {}});
    EXPECT_TRUE(engine.takeCalls().empty());
    distributed.setSuspended(false);
    EXPECT_EQ(engine.takeCalls(), Texts{"bringSourcesUpToDate"});
}

TEST_F(VaultraConduit, ANetworkThatComesBackStartsAPass) {
    network.up = false;
    conduit->open();
    network.up = true;
    center.post({kCXNetworkConfigurationDidChangeNotification, std::nullopt, {}});
    EXPECT_TRUE(log.has("Network changed"));
    EXPECT_FALSE(conduit->vaultraOffLine());
    EXPECT_EQ(engine.takeCalls(), Texts{"bringSourcesUpToDate"});
}

TEST_F(VaultraConduit, ANetworkThatGoesStartsNone) {
    open();
    network.up = false;
    center.post({kCXNetworkConfigurationDidChangeNotification, std::nullopt, {}});
    EXPECT_TRUE(conduit->vaultraOffLine());
    EXPECT_EQ(engine.takeCalls(), Texts{});
}

TEST_F(VaultraConduit, AChangedNetworkNeverAsksAboutThePassword) {
    use(std::make_unique<Client>(*world, "alice", "wrong"));
    center.post({kCXNetworkConfigurationDidChangeNotification, std::nullopt, {}});
    EXPECT_TRUE(conduit->vaultraOffLine());
    EXPECT_TRUE(alert.shown.empty());
    EXPECT_EQ(engine.takeCalls(), Texts{});
}

// -- applying

TEST_F(VaultraConduit, LocksTheClockFileOfTheRecordsUserBeforeAnyChange) {
    open();
    apply(record(CXDRemoveRecordFromGroup, "P", "G"));
    apply(record(CXDRemoveRecordFromGroup, "P", "G", {}, "bob"));
    EXPECT_EQ(engine.takeCalls(), (Texts{kLockOfAlice, "lock http://contacts.example.org/bob/Contacts/dateFile"}));
}

TEST_F(VaultraConduit, WithoutTheLockNothingIsSent) {
    open();
    engine.locks = false;
    EXPECT_FALSE(apply(record(CXDUpdateRecord, "P", nullptr, Dictionary())));
    EXPECT_FALSE(denied);
    EXPECT_EQ(client->wire->methods(), "");
}

TEST_F(VaultraConduit, AContactsDataIsWrittenWithOneRequest) {
    open();
    const Dictionary contact{{"First", "Zo\xC3\xAB"}, {"Photo", Bytes{1, 2, 3}}};
    EXPECT_TRUE(apply(record(CXDUpdateRecord, "abc", nullptr, contact)));
    EXPECT_FALSE(denied);
    EXPECT_EQ(client->wire->methods(), "PUT");
    EXPECT_EQ(plist("People/16/abc"), Value(contact));
}

TEST_F(VaultraConduit, AnEncodedPayloadIsWrittenAndStaysEncoded) {
    open();
    const Dictionary contact{{"First", "Ada"}};
    const auto update = record(CXDUpdateRecord, "abc", nullptr);
    update->setEncodedPayload(std::make_shared<const Bytes>(BinaryValue::encode(contact)));
    EXPECT_TRUE(apply(update));
    EXPECT_EQ(plist("People/16/abc"), Value(contact));
    EXPECT_NE(update->encodedPayload(), nullptr) << "a tree of the payload is left in the record";
}

TEST_F(VaultraConduit, ANewGroupGetsADirectoryAndItsInformation) {
    open();
    const Dictionary info{{kCXGroupNameProperty, "Friends"}, {"else", 1}};
    EXPECT_TRUE(apply(record(CXDCreateStructureForGroup, nullptr, "G:CXGroup", info)));
    EXPECT_EQ(plist("G:CXGroup/info"), Value(info));
}

TEST_F(VaultraConduit, WhetherTheDirectoryCouldBeMadeShowsInTheWriteBelowIt) {
    open();
    ASSERT_TRUE(apply(record(CXDCreateStructureForGroup, nullptr, "G:CXGroup", Dictionary{{"else", 1}})));
    answerEvery("MKCOL", 500);
    const Dictionary info{{kCXGroupNameProperty, "Friends"}};
    EXPECT_TRUE(apply(record(CXDCreateStructureForGroup, nullptr, "G:CXGroup", info)));
    EXPECT_EQ(plist("G:CXGroup/info"), Value(info));
    answerEvery("MKCOL", 403);
    EXPECT_FALSE(apply(record(CXDCreateStructureForGroup, nullptr, "H:CXGroup", info)));
    EXPECT_FALSE(denied) << "the write found no directory, and that is tried again";
}

TEST_F(VaultraConduit, ARenameDropsEveryOtherKeyOfTheInformation) {
    open();
    apply(record(CXDCreateStructureForGroup, nullptr, "G:CXGroup", Dictionary{{"else", 1}}));
    EXPECT_TRUE(apply(record(CXDChangeGroupName, nullptr, "G:CXGroup", "New")));
    EXPECT_EQ(plist("G:CXGroup/info"), Value(Dictionary{{kCXGroupNameProperty, "New"}}));
}

TEST_F(VaultraConduit, AMemberGetsAMarkerThatItsRemovalLeaves) {
    open();
    apply(record(CXDCreateStructureForGroup, nullptr, "G:CXGroup", Dictionary()));
    EXPECT_TRUE(apply(record(CXDAddRecordToGroup, "P", "G:CXGroup")));
    EXPECT_EQ(world->contents("G:CXGroup/P"), "Distribution Lists Go Here");
    client->wire->clear();
    EXPECT_TRUE(apply(record(CXDRemoveRecordFromGroup, "P", "G:CXGroup")));
    EXPECT_EQ(client->wire->methods(), "");
    EXPECT_EQ(world->contents("G:CXGroup/P"), "Distribution Lists Go Here");
}

TEST_F(VaultraConduit, ACompositeChangeMakesTheGroupsStateAndThenContinuesIt) {
    open();
    EXPECT_TRUE(apply(record(CXDCompositeGroupChange, nullptr, "G:CXGroup",
                             Dictionary{{"memberAdds", Array{"a", "b", "a"}}, {kCXGroupNameProperty, "F"}})))
        << client->wire->text();
    EXPECT_TRUE(apply(record(CXDCompositeGroupChange, nullptr, "G:CXGroup",
                             Dictionary{{"memberAdds", Array{"c"}}, {"memberRemoves", Array{"a"}}})));
    const auto [code, state] = client->read("G:CXGroup");
    ASSERT_TRUE(state) << code;
    EXPECT_EQ((*state)["memberUIDState"], Value(Array{"b", "c"}));
    EXPECT_EQ((*state)[kCXGroupNameProperty], Value("F"));
}

TEST_F(VaultraConduit, AGroupsStateAndItsDirectoryLiveAtOnePath) {
    open();
    apply(record(CXDCreateStructureForGroup, nullptr, "G:CXGroup", Dictionary{{kCXGroupNameProperty, "F"}}));
    EXPECT_TRUE(apply(record(CXDCompositeGroupChange, nullptr, "G:CXGroup", Dictionary{{"memberAdds", Array{"a"}}})));
    EXPECT_EQ(client->read("G:CXGroup").second.value_or(Dictionary())["memberUIDState"], Value(Array{"a"}));
    EXPECT_EQ(plist("G:CXGroup/info"), Value(Dictionary{{kCXGroupNameProperty, "F"}}));
}

TEST_F(VaultraConduit, ACompositeChangeWithoutAPayloadLeavesTheStateAsItIs) {
    open();
    apply(record(CXDCompositeGroupChange, nullptr, "G:CXGroup", Dictionary{{"memberAdds", Array{"a"}}}));
    EXPECT_TRUE(apply(record(CXDCompositeGroupChange, nullptr, "G:CXGroup")));
    EXPECT_EQ(client->read("G:CXGroup").second.value_or(Dictionary())["memberUIDState"], Value(Array{"a"}));
}

// The members that are not in the payload would be lost.
TEST_F(VaultraConduit, AGroupsStateThatCannotBeReadIsNotReplacedByAPartOfIt) {
    open();
    apply(record(CXDCompositeGroupChange, nullptr, "G:CXGroup", Dictionary{{"memberAdds", Array{"a", "b"}}}));
    for (int status : {500, 503, 403, 401}) {
        answerEvery("GET", status);
        EXPECT_FALSE(
            apply(record(CXDCompositeGroupChange, nullptr, "G:CXGroup", Dictionary{{"memberAdds", Array{"c"}}})))
            << status;
        EXPECT_EQ(denied, status == 403) << status << ": all of the tree is closed";
    }
    client->wire->intercept(nullptr);
    EXPECT_EQ(client->read("G:CXGroup").second.value_or(Dictionary())["memberUIDState"], Value(Array{"a", "b"}));
}

// A server that lost its power has such files.
TEST_F(VaultraConduit, AGroupsStateThatCameToHarmIsWrittenAnewFromWhatItHeldLast) {
    open();
    engine.priorState(kConduitVaultra)
        .dictionaryFor("<self>")
        .set("G:CXGroup", Dictionary{{"memberUIDState", Array{"a", "b"}},
                                     {kCXGroupNameProperty, "F"},
                                     {kCXReadWriteSharingACLProperty, Array{"bob"}}});
    client->write("G:CXGroup", std::string());
    const auto adds = Dictionary{{"memberAdds", Array{"c"}}};
    EXPECT_TRUE(apply(record(CXDCompositeGroupChange, nullptr, "G:CXGroup", adds))) << client->wire->text();
    const Dictionary state = client->read("G:CXGroup").second.value_or(Dictionary());
    EXPECT_EQ(state["memberUIDState"], Value(Array{"a", "b", "c"}));
    EXPECT_EQ(state[kCXGroupNameProperty], Value("F"));
    EXPECT_FALSE(state.contains(kCXReadWriteSharingACLProperty)) << "who may write is nobody else's business";

    std::filesystem::remove(world->file("G:CXGroup"));
    EXPECT_TRUE(apply(record(CXDCompositeGroupChange, nullptr, "G:CXGroup", adds)));
    const Dictionary anew = client->read("G:CXGroup").second.value_or(Dictionary());
    EXPECT_EQ(anew["memberUIDState"], Value(Array{"a", "b", "c"})) << "a list of the change alone would be a lost one";
    EXPECT_EQ(anew[kCXGroupNameProperty], Value("F"));
}

TEST_F(VaultraConduit, AGroupThatSomebodyElseChangedMeanwhileIsTriedAgainLater) {
    open();
    apply(record(CXDCompositeGroupChange, nullptr, "G:CXGroup", Dictionary{{"memberAdds", Array{"a"}}}));
    Client other(*world);
    bool interfered = false;
    client->wire->intercept([&](const HttpRequest& request) -> std::optional<HttpResponse> {
        if (request.method == "PUT" && !std::exchange(interfered, true))
            other.write("G:CXGroup", Dictionary{{"memberUIDState", Array{"a", "theirs"}}});
        return std::nullopt;
    });
    const auto change = record(CXDCompositeGroupChange, nullptr, "G:CXGroup", Dictionary{{"memberAdds", Array{"b"}}});
    EXPECT_FALSE(apply(change));
    EXPECT_FALSE(denied);
    EXPECT_TRUE(apply(change));
    EXPECT_EQ(client->read("G:CXGroup").second.value_or(Dictionary())["memberUIDState"],
              Value(Array{"a", "theirs", "b"}));
}

TEST_F(VaultraConduit, DeletesAContactsFile) {
    open();
    apply(record(CXDUpdateRecord, "abc", nullptr, Dictionary()));
    EXPECT_TRUE(apply(record(CXDDeleteRecord, "abc", nullptr)));
    EXPECT_FALSE(std::filesystem::exists(world->file("People/16/abc")));
    EXPECT_FALSE(apply(record(CXDDeleteRecord, nullptr, "G"))) << "a record without a person";
    EXPECT_FALSE(denied);
}

TEST_F(VaultraConduit, DeletesAGroupWithAllThatLiesInIt) {
    open();
    apply(record(CXDCreateStructureForGroup, nullptr, "G:CXGroup", Dictionary()));
    apply(record(CXDAddRecordToGroup, "P", "G:CXGroup"));
    EXPECT_TRUE(apply(record(CXDDeleteGroup, nullptr, "G:CXGroup")));
    EXPECT_FALSE(std::filesystem::exists(world->file("G:CXGroup")));
    EXPECT_FALSE(apply(record(CXDDeleteGroup, "P", nullptr))) << "a record without a group";
}

TEST_F(VaultraConduit, RecordsWithoutWhatTheyNameFailAndSendNothing) {
    open();
    EXPECT_FALSE(apply(record(CXDUpdateRecord, nullptr, "G", Dictionary())));
    EXPECT_FALSE(apply(record(CXDCreateStructureForGroup, "P", nullptr, Dictionary())));
    EXPECT_FALSE(apply(record(CXDCompositeGroupChange, "P", nullptr, Dictionary())));
    EXPECT_FALSE(apply(record(CXDChangeGroupName, "P", nullptr, "New")));
    EXPECT_FALSE(apply(record(CXDAddRecordToGroup, "P", nullptr)));
    EXPECT_FALSE(apply(
        std::make_shared<CXDChangeRecord>(CXDSyncSourceCX, CXDUpdateRecord, std::nullopt, UniqueId("P"), std::nullopt)))
        << "a record of nobody";
    EXPECT_EQ(client->wire->methods(), "");
}

TEST_F(VaultraConduit, ARecordThatIsCalledLikeTheTreesOwnFilesTouchesNothingAndIsRefusedForGood) {
    open();
    const auto refused = [&](const CXDChangeRecordPtr& each, const std::string& name) {
        engine.refused.clear();
        log.clear();
        denied = true;
        EXPECT_TRUE(conduit->applyChangeRecordIfNeeded(each, &denied)) << name << ": it would wait for ever";
        EXPECT_FALSE(denied) << name << ": the user's other changes are not to go with it";
        ASSERT_EQ(engine.refused.size(), 1u) << name;
        EXPECT_EQ(engine.refused[0].user, each->user());
        EXPECT_EQ(engine.refused[0].why, kRefusedForItsName);
        EXPECT_EQ(log.lines().size(), 1u) << log.text();
        EXPECT_NE(log.text().find("\"" + name + "\" is a name of the published tree's own"), std::string::npos);
    };
    for (const char* name : {"People", "info", "dateFile", "Contacts", ".state", "..", ""}) {
        for (const int type : {CXDCreateStructureForGroup, CXDCompositeGroupChange, CXDChangeGroupName, CXDDeleteGroup})
            refused(record(type, nullptr, name, Dictionary()), name);
        refused(record(CXDAddRecordToGroup, name, "G:CXGroup"), name);
        refused(record(CXDDeleteRecord, name, nullptr), name);
    }
    EXPECT_EQ(client->wire->methods(), "");
    EXPECT_TRUE(std::filesystem::is_directory(world->file("People/31")));
}

// Which of an account's two endpoints a write goes to: contacts and what names them never leave unencrypted.
TEST_F(VaultraConduit, ContactsAndStatesAreWrittenSecurelyMarkersNamesAndTheClockAreNot) {
    CXDAVAccount account;
    account.user = UserName("alice");
    account.endpoint = "http://localhost:1/dav/{user}/Contacts";
    account.secureEndpoint = "https://localhost:2/dav/{user}/Contacts";
    account.nameHost = "contacts.example.org";
    account.plainLoopback = true;
    const auto wire = std::make_shared<RecordingTransport>();
    Texts asked;
    wire->intercept([&](const HttpRequest& request) {
        if (request.method == "PUT" || request.method == "GET")
            asked.push_back(request.url.scheme() + " " + request.method + " " + request.url.cxLastComponent());
        if (request.method == "OPTIONS") return answerOf(200, {{"dav", "1, 2"}});
        if (request.method == "HEAD") return answerOf(200, {{"last-modified", "Sat, 21 Nov 2026 10:00:00 GMT"}});
        return answerOf(request.method == "GET" ? 404 : 201);
    });
    CXDAVManager manager(account, wire);
    CXDVaultraConduit plain(engine, CXDVaultraConduit::Collaborators{manager, network, preferences, clock, center,
                                                                     distributed, alert, database});
    const auto requestsOf = [&](const CXDChangeRecordPtr& change) {
        asked.clear();
        EXPECT_TRUE(plain.applyChangeRecord(change));
        return asked;
    };
    EXPECT_EQ(requestsOf(record(CXDUpdateRecord, "P", nullptr, Dictionary())), Texts{"https PUT P"});
    EXPECT_EQ(requestsOf(record(CXDCreateStructureForGroup, nullptr, "G", Dictionary())), Texts{"https PUT info"});
    EXPECT_EQ(requestsOf(record(CXDCompositeGroupChange, nullptr, "G", Dictionary())),
              (Texts{"http GET G", "https PUT G"}));
    EXPECT_EQ(requestsOf(record(CXDChangeGroupName, nullptr, "G", "New")), Texts{"http PUT info"});
    EXPECT_EQ(requestsOf(record(CXDAddRecordToGroup, "P", "G")), Texts{"http PUT P"});
    asked.clear();
    EXPECT_TRUE(plain.currentServerDate());
    EXPECT_EQ(asked, Texts{"http PUT dateFile"});
}

TEST_F(VaultraConduit, TheServersDateIsAskedForWhateverBecameOfTheWrite) {
    open();
    const auto before = client->manager.modDateForURL(client->at("dateFile"));
    ASSERT_TRUE(before);
    answerEvery("PUT", 507);
    EXPECT_EQ(conduit->currentServerDate(), before);
}

TEST_F(VaultraConduit, ChangesThatTheStoreHasNoPlaceForFail) {
    open();
    for (int type : std::initializer_list<int>{0, CXDAddGroupToGroup, CXDUpdateDistributionList,
                                               CXDRemoveDistributionListFromGroup, CXDRemoveGroupFromGroup, 42}) {
        EXPECT_FALSE(apply(record(type, "P", "G:CXGroup", Dictionary()))) << type;
        EXPECT_FALSE(denied) << type;
    }
    EXPECT_EQ(client->wire->methods(), "");
}

TEST_F(VaultraConduit, Status403AloneIsADenial) {
    open();
    for (int status : {401, 403, 404, 405, 412, 423, 500, 503, 507}) {
        answerEvery("PUT", status);
        EXPECT_FALSE(apply(record(CXDUpdateRecord, "P", nullptr, Dictionary()))) << status;
        EXPECT_EQ(denied, status == 403) << status;
        EXPECT_FALSE(conduit->applyChangeRecord(record(CXDUpdateRecord, "P", nullptr, Dictionary())))
            << "no flag is given";
    }
}

TEST_F(VaultraConduit, SomebodyElsesTreeIsDeniedByTheStoreItself) {
    open();
    EXPECT_FALSE(apply(record(CXDUpdateRecord, "P", nullptr, Dictionary(), "bob")));
    EXPECT_TRUE(denied) << client->wire->text();
}

// -- access lists

TEST_F(VaultraConduit, AccessListChangesReachTheManagerOfTheUsersTreeAndNeverFail) {
    open();
    EXPECT_TRUE(apply(record(CXDChangeGroupReadACL, nullptr, "AllCXGroup",
                             Dictionary{{"additions", Array{"bob", "eve"}}, {"deletions", Array{}}})));
    EXPECT_TRUE(apply(record(CXDChangeGroupReadWriteACL, nullptr, "AllCXGroup",
                             Dictionary{{"additions", Array{"carl"}}, {"deletions", Array{}}})));
    EXPECT_TRUE(apply(record(CXDChangeGroupReadACL, nullptr, "AllCXGroup",
                             Dictionary{{"additions", Array{"bob"}}, {"deletions", Array{"bob"}}})));
    ASSERT_EQ(managers.size(), 1u);
    EXPECT_EQ(managers[0]->baseLocation().absoluteString(), "http://contacts.example.org/alice/Contacts");
    EXPECT_TRUE(managers[0]->publisher());
    EXPECT_EQ(managers[0]->principalsWithReadAccess(), (std::vector<UserName>{UserName("eve"), UserName("carl")}))
        << "a change grants before it denies";
    EXPECT_EQ(managers[0]->principalsWithAllAccess(), std::vector<UserName>{UserName("carl")});
    EXPECT_EQ(client->wire->methods(), "") << "the lists are sent when the managers are saved";
}

TEST_F(VaultraConduit, DenyingReadWriteKeepsTheReader) {
    open();
    apply(record(CXDChangeGroupReadWriteACL, nullptr, "AllCXGroup", Dictionary{{"additions", Array{"bob"}}}));
    apply(record(CXDChangeGroupReadWriteACL, nullptr, "AllCXGroup", Dictionary{{"deletions", Array{"bob"}}}));
    EXPECT_EQ(managers.at(0)->principalsWithReadAccess(), std::vector<UserName>{UserName("bob")});
    EXPECT_TRUE(managers.at(0)->principalsWithAllAccess().empty());
}

TEST_F(VaultraConduit, OneManagerServesEveryLocationOfAUser) {
    const auto one = conduit->ACLManagerForRemoteLocation(Url("http://contacts.example.org/bob/Contacts"));
    EXPECT_EQ(conduit->ACLManagerForRemoteLocation(Url("http://elsewhere.example.org/bob")), one);
    EXPECT_NE(conduit->ACLManagerForRemoteLocation(Url("http://contacts.example.org/ALICE/Contacts")), one);
    EXPECT_EQ(managers.size(), 2u);
    EXPECT_EQ(managers[1]->baseLocation().absoluteString(), "http://contacts.example.org/alice/Contacts");
}

// -- several workers

TEST_F(VaultraConduit, TenWorkersApplyRecordsSideBySide) {
    open();
    constexpr int kWorkers = 10, kEach = 20;
    std::atomic<int> applied = 0;
    std::vector<std::thread> workers;
    for (int w = 0; w < kWorkers; ++w)
        workers.emplace_back([&, w] {
            for (int i = 0; i < kEach; ++i) {
                const std::string name = std::to_string(w) + "-" + std::to_string(i);
                const auto update = record(CXDUpdateRecord, name.c_str(), nullptr);
                update->setEncodedPayload(
                    std::make_shared<const Bytes>(BinaryValue::encode(Dictionary{{"First", name}})));
                bool refused = true;
                applied += conduit->applyChangeRecordIfNeeded(update, &refused) && !refused;
                if (i % 10) continue;
                const std::string group = name + ":CXGroup";
                applied += conduit->applyChangeRecordIfNeeded(
                    record(CXDCompositeGroupChange, nullptr, group.c_str(), Dictionary{{"memberAdds", Array{name}}}));
            }
        });
    for (auto& worker : workers) worker.join();
    EXPECT_EQ(applied, kWorkers * (kEach + kEach / 10)) << client->wire->text();
    for (int w = 0; w < kWorkers; ++w)
        for (int i = 0; i < kEach; ++i) {
            const UniqueId name(std::to_string(w) + "-" + std::to_string(i));
            EXPECT_EQ(plist("People/" + CXACLManager::bucketNameForUID(name) + "/" + name.str()),
                      Value(Dictionary{{"First", name}}));
        }
    EXPECT_EQ(client->read("3-10:CXGroup").second.value_or(Dictionary())["memberUIDState"], Value(Array{"3-10"}));
}
