#include "../store/AclStore.h"
#include "DaemonDatabase.h"
#include "FakeEngine.h"
#include "acl/CXDAVACLManager.h"
#include "conduits/UserAlert.h"
#include "conduits/store/CXDVaultraConduit.h"
#include "contacts/database/CXRolvane.h"
#include "contacts/database/DaemonMemory.h"
#include "contacts/records/Constants.h"
#include "foundation/Preferences.h"
#include "store/account/CXNetworkController.h"
#include "support/CapturingLog.h"

#include <gtest/gtest.h>

using namespace rolvane;
using namespace rolvane::test;

namespace {

struct AlwaysUp : CXNetworkController {
    bool canReachAddress(const std::string&) override { return true; }
};
struct NoAlert : UserAlert {
    void show(const Text&) override {}
    void tell(const Text&) override {}
};

// The network store's conduit of alice, over a store that keeps access lists; bob publishes there, too.
class StoreRights : public testing::Test {
protected:
    StoreRights() {
        engine.account = UserName("alice");
        store.instead = [this](const HttpRequest& r) { return answer(r); };
        conduit = std::make_unique<CXDVaultraConduit>(
            engine, CXDVaultraConduit::Collaborators{*store.manager, network, preferences, clock, center, distributed,
                                                     alert, database});
    }
    std::optional<HttpResponse> answer(const HttpRequest& r) {
        const bool bobs = r.url.encodedPath().starts_with("/dav/bob/");
        if (bobs && r.method == "PROPFIND")
            return AclStore::multistatus(
                AclStore::response(r.url.encodedPath(), "<D:current-user-privilege-set><D:privilege><D:" + bobGrants +
                                                            "/></D:privilege></D:current-user-privilege-set>"));
        if (failsLists && r.body && r.body->find("<D:acl/>") != std::string::npos) return answerOf(500);
        return std::nullopt;
    }
    Texts changes(const Url& location) {
        Texts all;
        for (const auto& record : conduit->changeRecordsForACLAtRemoteLocation(location))
            all.push_back(std::to_string(record->type()) + " +" +
                          Value(record->payload().dictionary()["additions"]).description() + " -" +
                          Value(record->payload().dictionary()["deletions"]).description());
        return all;
    }
    void remember(const char* user, const char* property, std::initializer_list<const char*> names) {
        Array all;
        for (const char* name : names) all.append(name);
        engine.priorState("CXDCX").dictionaryFor(user).dictionaryFor("AllCXGroup").set(property, all);
    }
    static std::string list(const std::string& name) { return Value(Array{name}).description(); }
    const std::string kNone = Value(Array{}).description();

    const Url kBobs{"http://dav.example.org/bob/Contacts"};
    TempDirectory directory;
    AclStore store;
    std::string bobGrants = "read";
    bool failsLists = false;
    FakeEngine engine;
    AlwaysUp network;
    NoAlert alert;
    ManualClock clock{Date(1'800'000'000)};
    NotificationCenter center;
    LocalNotifications distributed;
    Preferences preferences{directory / "preferences.db", daemonMemory(directory / "contacts.db")};
    CXRolvane database{daemonDatabase(directory, clock, center)};
    CapturingLog log;
    std::unique_ptr<CXDVaultraConduit> conduit;
};

} // namespace

TEST_F(StoreRights, TheListsAreTheStoresOwn) {
    store.entries = {AclStore::ace("/principals/bob", {"read"})};
    const auto manager = conduit->ACLManagerForRemoteLocation(store.base);
    ASSERT_TRUE(std::dynamic_pointer_cast<CXDAVACLManager>(manager));
    EXPECT_EQ(manager->principalsWithReadAccess(), std::vector<UserName>{UserName("bob")});
    EXPECT_EQ(conduit->ACLManagerForRemoteLocation(store.base), manager);
}

TEST_F(StoreRights, WhatTheOwnerChangesReachesTheStoreWhenTheListsAreSaved) {
    const auto change = std::make_shared<CXDChangeRecord>(
        CXDSyncSourceCX, CXDChangeGroupReadWriteACL, kSelf, std::nullopt, UniqueId("AllCXGroup"),
        Dictionary{{"additions", Array{"bob"}}, {"deletions", Array{}}});
    conduit->open();
    EXPECT_TRUE(conduit->applyChangeRecord(change));
    EXPECT_EQ(store.lists(), "r; w");
    EXPECT_TRUE(conduit->saveACLs());
    EXPECT_EQ(store.lists(), "r bob; w bob");
    store.wire->clear();
    EXPECT_TRUE(conduit->saveACLs());
    EXPECT_EQ(store.wire->methods(), "") << "nothing has changed since";
}

TEST_F(StoreRights, ASubscriberHearsInTheNextPassThatTheRightsChanged) {
    remember("bob", kCXReadSharingACLProperty, {"<self>"});
    conduit->open();
    EXPECT_EQ(changes(kBobs), Texts{});
    bobGrants = "write";
    EXPECT_EQ(changes(kBobs), Texts{}) << "once a pass is enough";
    conduit->open();
    EXPECT_EQ(changes(kBobs), Texts{"8 +" + list("<self>") + " -" + kNone});
    remember("bob", kCXReadWriteSharingACLProperty, {"<self>"});
    bobGrants = "read";
    conduit->open();
    EXPECT_EQ(changes(kBobs), Texts{"8 +" + kNone + " -" + list("<self>")});
}

TEST_F(StoreRights, TheOwnersListIsKeptFromPassToPass) {
    conduit->open();
    const auto manager = conduit->ACLManagerForRemoteLocation(store.base);
    conduit->open();
    EXPECT_EQ(conduit->ACLManagerForRemoteLocation(store.base), manager) << "it may hold what is not saved yet";
}

// A list that could not be read says nothing; taken for an empty one, it would withdraw every right.
TEST_F(StoreRights, AnOwnersListThatCannotBeReadIsNotCompared) {
    remember("<self>", kCXReadSharingACLProperty, {"bob"});
    store.entries = {AclStore::ace("/principals/bob", {"read"}), AclStore::ace("/principals/carl", {"read"})};
    failsLists = true;
    conduit->open();
    EXPECT_EQ(changes(store.base), Texts{});
    EXPECT_TRUE(conduit->saveACLs());
    EXPECT_EQ(store.lists(), "r bob carl; w");
}

TEST_F(StoreRights, AStoreWithoutAccessListsComparesNothingAndIsAskedNothing) {
    store.announces = "1, 2";
    remember("bob", kCXReadWriteSharingACLProperty, {"<self>"});
    conduit->open();
    store.wire->clear();
    EXPECT_EQ(changes(kBobs), Texts{});
    EXPECT_EQ(changes(store.base), Texts{});
    EXPECT_EQ(store.wire->methods(), "");
}
