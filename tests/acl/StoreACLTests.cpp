#include "../store/AclStore.h"
#include "../store/StoreWorld.h"
#include "acl/CXDAVACLManager.h"
#include "foundation/CXException.h"
#include "support/CapturingLog.h"

#include <gtest/gtest.h>

using namespace rolvane;
using namespace rolvane::test;

namespace {

using Users = std::vector<UserName>;
using Names = std::vector<std::string>;

const UniqueId kAll{"AllCXGroup"};
const UserName kBob{"bob"};
const UserName kCarl{"carl"};

struct AliceOwns : LocationOwner {
    UserName userForRemoteLocation(const RemoteLocation& location) const override {
        return location.str().find("/alice/") != std::string::npos ? kSelf : UserName("bob");
    }
};

std::string privileges(const Names& names) {
    std::string out = "<D:current-user-privilege-set>";
    for (const auto& name : names) out += "<D:privilege><D:" + name + "/></D:privilege>";
    return out + "</D:current-user-privilege-set>";
}

CXDAVNode element(const char* name, std::vector<CXDAVNode> children = {}) {
    return CXDAVNode::element(name, std::move(children));
}
CXDAVNode root(std::vector<CXDAVNode> inDocument) {
    return element("", {element("", std::move(inDocument))});
}
CXDAVNode answered(const std::string& responses) {
    return parseDAVTree(AclStore::multistatus(responses).body).value_or(CXDAVNode::text("not well formed"));
}

// -- a location that somebody else published

class SubscribersRights : public testing::Test {
protected:
    CXDAVACLManager manager() { return {Url(kBobs), owner, *store.manager}; }
    // The manager after an answer to its query.
    Users writersAfter(const HttpResponse& answer) {
        answerQueries(answer);
        auto list = manager();
        EXPECT_FALSE(list.publisher());
        if (list.principalsWithReadAccess().empty()) return {UserName("not even a reader")};
        EXPECT_EQ(list.principalsWithReadAccess(), Users{kSelf});
        return list.principalsWithAllAccess();
    }
    bool loadsNothing(const HttpResponse& answer) {
        answerQueries(answer);
        auto list = manager();
        return !list.load() && list.principalsWithReadAccess().empty() && list.principalsWithAllAccess().empty();
    }
    void answerQueries(const HttpResponse& answer) {
        store.instead = [answer](const HttpRequest& r) {
            return r.method == "PROPFIND" ? std::optional(answer) : std::nullopt;
        };
    }

    static constexpr const char* kBobs = "http://dav.example.org/bob/Contacts";
    static constexpr const char* kEntry = "/dav/bob/Contacts/AllCXGroup";
    AliceOwns owner;
    AclStore store;
    CapturingLog log;
};

TEST_F(SubscribersRights, AreAskedOfTheAllContactsEntryByteForByte) {
    answerQueries(AclStore::multistatus(AclStore::response(kEntry, privileges({"read"}))));
    manager();
    ASSERT_EQ(store.wire->methods(), "PROPFIND");
    const auto asked = store.wire->exchanges().front();
    EXPECT_EQ(asked.path, kEntry);
    EXPECT_EQ(asked.header("Depth"), "infinity");
    EXPECT_EQ(asked.header("User-Agent"), CXDAVManager::ostrelUserAgent());
    EXPECT_EQ(store.bodies.front(), "<?xml version=\"1.0\" encoding=\"utf-8\" ?><D:propfind xmlns:D=\"DAV:\">\n"
                                    "<D:prop>\n"
                                    "<D:current-user-privilege-set/>\n"
                                    "</D:prop>\n"
                                    "</D:propfind>");
}

TEST_F(SubscribersRights, AreAskedAtTheSecureAddress) {
    CXDAVAccount account;
    account.user = UserName("alice");
    account.endpoint = "http://plain.example.org/dav/{user}/Contacts";
    account.secureEndpoint = "https://secure.example.org/dav/{user}/Contacts";
    auto wire = std::make_shared<RecordingTransport>();
    Names asked;
    wire->intercept([&](const HttpRequest& request) {
        asked.push_back(request.url.scheme() + " " + request.url.host());
        return std::optional(AclStore::multistatus(AclStore::response(kEntry, privileges({"read", "write"}))));
    });
    CXDAVManager client(account, wire);
    const Url bobs = account.baseLocationFor(UserName("bob"));
    const CXDAVACLManager list(bobs, owner, client);
    EXPECT_EQ(list.principalsWithAllAccess(), Users{kSelf});
    EXPECT_EQ(asked, Names{"https secure.example.org"});
}

TEST_F(SubscribersRights, AreAskedAboutTheEntryItselfWhereAnUnboundedDepthIsRefused) {
    Names depths;
    store.instead = [&](const HttpRequest& r) -> std::optional<HttpResponse> {
        if (r.method != "PROPFIND") return std::nullopt;
        depths.push_back(r.headers.front().second);
        if (depths.back() == "infinity") return answerOf(403);
        return AclStore::multistatus(AclStore::response(kEntry, privileges({"read", "write"})));
    };
    EXPECT_EQ(manager().principalsWithAllAccess(), Users{kSelf});
    EXPECT_EQ(depths, (Names{"infinity", "0"}));
}

TEST_F(SubscribersRights, AreReadingWithoutAPrivilegeToWrite) {
    EXPECT_EQ(writersAfter(AclStore::multistatus(AclStore::response(kEntry, privileges({"read"})))), Users{});
    EXPECT_EQ(writersAfter(AclStore::multistatus(AclStore::response(kEntry, privileges({})))), Users{});
    EXPECT_EQ(writersAfter(AclStore::multistatus(AclStore::response(kEntry, privileges({"read", "write-acl"})))),
              Users{});
}

TEST_F(SubscribersRights, AreWritingWhenTheServerReportsAPrivilegeToWrite) {
    EXPECT_EQ(writersAfter(AclStore::multistatus(AclStore::response(kEntry, privileges({"read", "write"})))),
              Users{kSelf});
    EXPECT_EQ(writersAfter(AclStore::multistatus(AclStore::response(kEntry, privileges({"all"})))), Users{kSelf});
}

TEST_F(SubscribersRights, AnyResponseMayGrantWriting) {
    EXPECT_EQ(
        writersAfter(AclStore::multistatus(AclStore::response(kEntry, privileges({"read"})) +
                                           AclStore::response(std::string(kEntry) + "/P", privileges({"write"})))),
        Users{kSelf});
}

TEST_F(SubscribersRights, AResponseWithoutHrefContributesNothing) {
    const std::string propstat =
        "<D:propstat><D:prop>" + privileges({"write"}) + "</D:prop><D:status>HTTP/1.1 200 OK</D:status></D:propstat>";
    EXPECT_EQ(writersAfter(AclStore::multistatus("<D:response>" + propstat + "</D:response>")), Users{});
    EXPECT_EQ(writersAfter(AclStore::multistatus("<D:response><D:href/>" + propstat + "</D:response>")), Users{});
    EXPECT_EQ(writersAfter(AclStore::multistatus("<D:response><D:href>/x</D:href>" + propstat + "</D:response>")),
              Users{kSelf});
}

TEST_F(SubscribersRights, AnotherNamespacesPrivilegeSetGrantsNothing) {
    const std::string alike = "<x:current-user-privilege-set xmlns:x=\"urn:x\"><D:privilege><D:write/></D:privilege>"
                              "</x:current-user-privilege-set>";
    EXPECT_EQ(writersAfter(AclStore::multistatus(AclStore::response(kEntry, alike))), Users{});
}

TEST_F(SubscribersRights, AreUnknownWhenTheAnswerIsMalformed) {
    const std::string good = AclStore::response(kEntry, privileges({"write"}));
    EXPECT_TRUE(loadsNothing(AclStore::multistatus("")));
    EXPECT_TRUE(loadsNothing(answerOf(207, {}, "<D:other xmlns:D=\"DAV:\">" + good + "</D:other>")));
    EXPECT_TRUE(loadsNothing(answerOf(207, {}, "<multistatus>" + good + "</multistatus>")));
    EXPECT_TRUE(loadsNothing(answerOf(207, {}, "not XML")));
    for (const int status : {401, 403, 404, 500})
        EXPECT_TRUE(loadsNothing(answerOf(status, {}, AclStore::multistatus(good).body))) << status;
    EXPECT_TRUE(loadsNothing(answerOf(200, {}, "<html/>")));
    const std::string whole = AclStore::multistatus(good).body;
    for (size_t n = 0; n + 2 < whole.size(); n += 5)
        EXPECT_TRUE(loadsNothing(answerOf(207, {}, whole.substr(0, n)))) << n;
}

TEST_F(SubscribersRights, AreReadOfAServerThatSays200WithTheSameDocument) {
    const std::string good = AclStore::response(kEntry, privileges({"write"}));
    EXPECT_EQ(writersAfter(answerOf(200, {}, AclStore::multistatus(good).body)), Users{kSelf});
}

TEST_F(SubscribersRights, AnAnswerWithTwoMultistatusElementsIsRejected) {
    const CXDAVNode response = element("response", {element("href", {CXDAVNode::text("/x")})});
    EXPECT_TRUE(CXDAVACLManager::rightsIn(root({element("multistatus", {response})})));
    EXPECT_FALSE(
        CXDAVACLManager::rightsIn(root({element("multistatus", {response}), element("multistatus", {response})})));
    EXPECT_FALSE(CXDAVACLManager::rightsIn(element("", {element("multistatus", {response}), element("multistatus")})));
    EXPECT_FALSE(CXDAVACLManager::rightsIn(root({element("multistatus")})));
    EXPECT_FALSE(CXDAVACLManager::rightsIn(element("")));
    const std::string one = AclStore::multistatus(AclStore::response(kEntry, privileges({"write"}))).body;
    EXPECT_TRUE(loadsNothing(answerOf(207, {}, one + one.substr(one.find("<D:multistatus")))));
}

TEST_F(SubscribersRights, SavingSendsNothingAndSucceeds) {
    answerQueries(AclStore::multistatus(AclStore::response(kEntry, privileges({"write"}))));
    auto list = manager();
    list.grantReadWritePermissionForGUID(kAll, {}, kCarl);
    list.denyReadPermissionForGUID(kAll, {}, kSelf);
    store.wire->clear();
    EXPECT_TRUE(list.save());
    EXPECT_TRUE(list.saveSimpleACL());
    answerQueries(answerOf(500));
    EXPECT_TRUE(manager().save()) << "known or not";
    EXPECT_EQ(store.wire->count("ACL"), 0u);
}

TEST_F(SubscribersRights, LoadingAgainAddsOnly) {
    answerQueries(AclStore::multistatus(AclStore::response(kEntry, privileges({"write"}))));
    auto list = manager();
    answerQueries(AclStore::multistatus(AclStore::response(kEntry, privileges({"read"}))));
    EXPECT_TRUE(list.load());
    EXPECT_EQ(list.principalsWithAllAccess(), Users{kSelf});
}

// -- the resource set, which nothing keeps

TEST_F(SubscribersRights, TheResourceSetIsAskedOfTheBaseByteForByteAndKeepsNothing) {
    answerQueries(AclStore::multistatus(AclStore::response(
        "/dav/bob/Contacts", "<a:access-control-resource-set xmlns:a=\"http://rolvane.net/ns/\"><D:entry/>"
                             "</a:access-control-resource-set>")));
    auto list = manager();
    const auto readers = list.principalsWithReadAccess();
    store.wire->clear();
    store.bodies.clear();
    EXPECT_TRUE(list.publisherLoadResourceSet());
    EXPECT_EQ(store.wire->exchanges().front().path, "/dav/bob/Contacts");
    EXPECT_EQ(store.wire->exchanges().front().header("Depth"), "infinity");
    EXPECT_EQ(store.bodies.front(), "<?xml version=\"1.0\" encoding=\"utf-8\" ?><D:propfind xmlns:D=\"DAV:\">\n"
                                    "<D:prop>\n"
                                    "<access-control-resource-set xmlns=\"http://rolvane.net/ns/\"/>\n"
                                    "</D:prop>\n"
                                    "</D:propfind>");
    EXPECT_EQ(list.principalsWithReadAccess(), readers);
    EXPECT_TRUE(list.principalsWithAllAccess().empty());
    answerQueries(answerOf(500));
    EXPECT_FALSE(list.publisherLoadResourceSet());
    answerQueries(AclStore::multistatus(""));
    EXPECT_FALSE(list.publisherLoadResourceSet());
}

TEST_F(SubscribersRights, TheResourceSetNamesMembersBesideTheServersRootAndTheirEntries) {
    const std::string entry = "<D:member><D:href>/dav/b%C3%B6b</D:href>" + AclStore::ace("/principals/bob", {"read"}) +
                              "<D:ace/></D:member><D:member/>";
    const auto resources = CXDAVACLManager::resourcesIn(
        answered(AclStore::response("/dav/bob%20x", "<a:ACCESS-control-resource-set xmlns:a=\"urn:a\">" + entry +
                                                        "</a:ACCESS-control-resource-set>") +
                 "<D:response/>"),
        Url(kBobs));
    ASSERT_TRUE(resources);
    ASSERT_EQ(resources->size(), 1u);
    EXPECT_EQ(resources->begin()->first, "/dav/bob x");
    const auto& resource = resources->begin()->second;
    ASSERT_EQ(resource.members.size(), 1u);
    EXPECT_EQ(resource.members[0].absoluteString(), "http://dav.example.org:80/%2Fdav%2Fb%C3%B6b");
    ASSERT_EQ(resource.entries.size(), 1u);
    EXPECT_EQ(resource.entries[0].href(), "/principals/bob");
}

// -- the owner's own list

class PublishersList : public testing::Test {
protected:
    CXDAVACLManager manager() { return {store.base, owner, *store.manager}; }
    void failReading(bool fails) {
        if (!fails) return void(store.instead = nullptr);
        store.instead = [](const HttpRequest& r) {
            return r.method == "PROPFIND" ? std::optional(answerOf(500)) : std::nullopt;
        };
    }
    AliceOwns owner;
    AclStore store;
    CapturingLog log;
};

TEST_F(PublishersList, IsReadFromTheStore) {
    store.entries = {AclStore::ace("/principals/bob", {"read"}), AclStore::ace("/principals/carl", {"read", "write"})};
    const auto list = manager();
    EXPECT_TRUE(list.publisher());
    EXPECT_TRUE(list.isKnown());
    EXPECT_EQ(list.principalsWithReadAccess(), (Users{kBob, kCarl}));
    EXPECT_EQ(list.principalsWithAllAccess(), Users{kCarl});
}

TEST_F(PublishersList, IsReadOverTLSAndSetUnderTheNameAsItStands) {
    struct Asked : CXDAVManager {
        using CXDAVManager::CXDAVManager;
        bool ACLsAtURL(const Url& url, Names&, Names&) override {
            return asked.push_back("load " + url.absoluteString()), true;
        }
        bool setACLsWithReadPrincipals(const Names& r, const Names& w, const Url& url) override {
            asked.push_back("set " + std::to_string(r.size()) + " " + std::to_string(w.size()) + " " +
                            url.absoluteString());
            return answer;
        }
        Names asked;
        bool answer = true;
    } client(store.manager->account(), store.wire);
    CXDAVACLManager list(store.base, owner, client);
    list.grantReadWritePermissionForGUID(kAll, {}, kBob);
    list.grantReadPermissionForGUID(kAll, {}, kCarl);
    EXPECT_TRUE(list.save());
    client.answer = false;
    EXPECT_FALSE(list.save());
    EXPECT_EQ(client.asked,
              (Names{"load https://dav.example.org/alice/Contacts", "set 2 1 http://dav.example.org/alice/Contacts",
                     "set 2 1 http://dav.example.org/alice/Contacts"}));
}

TEST_F(PublishersList, GrantsAndDenialsReachTheStoreWithTheSave) {
    auto list = manager();
    list.grantReadPermissionForGUID(kAll, {}, kBob);
    list.grantReadWritePermissionForGUID(kAll, {}, kCarl);
    EXPECT_EQ(store.lists(), "r; w") << "not before the save";
    EXPECT_TRUE(list.save());
    EXPECT_EQ(store.lists(), "r bob carl; w carl");
    list.denyReadWritePermissionForGUID(kAll, {}, kCarl);
    list.denyReadPermissionForGUID(kAll, {}, kBob);
    EXPECT_TRUE(list.save());
    EXPECT_EQ(store.lists(), "r carl; w");
}

TEST_F(PublishersList, SavingWhatDidNotChangeSendsNothing) {
    store.entries = {AclStore::ace("/principals/bob", {"read"})};
    auto list = manager();
    store.wire->clear();
    EXPECT_TRUE(list.save());
    EXPECT_TRUE(list.save());
    EXPECT_EQ(store.wire->methods(), "");
}

TEST_F(PublishersList, ThatWasNeverSeenIsNotReplaced) {
    store.entries = {AclStore::ace("/principals/bob", {"read"}), AclStore::ace("/principals/carl", {"read", "write"})};
    failReading(true);
    auto list = manager();
    EXPECT_FALSE(list.isKnown());
    EXPECT_TRUE(list.principalsWithReadAccess().empty());
    EXPECT_FALSE(list.save());
    list.denyReadPermissionForGUID(kAll, {}, kCarl);
    store.people["/principals/dora"] = "Dora";
    list.grantReadPermissionForGUID(kAll, {}, UserName("dora"));
    EXPECT_FALSE(list.save());
    EXPECT_EQ(store.wire->count("ACL"), 0u);

    failReading(false);
    EXPECT_TRUE(list.save());
    EXPECT_TRUE(list.isKnown());
    EXPECT_EQ(store.lists(), "r bob dora; w") << "what was asked for meanwhile is done, and nothing else";
    EXPECT_EQ(list.principalsWithReadAccess(), (Users{kBob, UserName("dora")}));
}

TEST_F(PublishersList, ASaveThatTheStoreRefusesIsTriedAgainWithTheNext) {
    auto list = manager();
    list.grantReadPermissionForGUID(kAll, {}, kBob);
    store.setStatus = 423;
    EXPECT_FALSE(list.save());
    store.setStatus = 200;
    EXPECT_TRUE(list.save());
    EXPECT_EQ(store.lists(), "r bob; w");
}

TEST_F(PublishersList, AnExceptionOfTheClientIsLoggedAtAnyDebugLevelAndFails) {
    struct Raising : CXDAVManager {
        using CXDAVManager::CXDAVManager;
        bool ACLsAtURL(const Url&, Names&, Names&) override { return true; }
        bool setACLsWithReadPrincipals(const Names&, const Names&, const Url&) override {
            throw CXException("CXTest", "the line was cut");
        }
    } client(store.manager->account(), store.wire);
    CXDAVACLManager list(store.base, owner, client);
    EXPECT_FALSE(list.save());
    EXPECT_EQ(log.lines(), Names{"Exception saving ACL: the line was cut"});
}

TEST_F(PublishersList, IsUnknownAndCostsNothingWhereTheStoreKeepsNoLists) {
    store.announces = "1, 2";
    auto list = manager();
    EXPECT_FALSE(list.isKnown());
    list.grantReadPermissionForGUID(kAll, {}, kBob);
    EXPECT_FALSE(list.save());
    EXPECT_FALSE(list.save());
    EXPECT_EQ(store.wire->methods(), "OPTIONS");
}

TEST(PlainStoresRights, ASubscriberReadsAndTheOwnersListIsUnknown) {
    const StoreWorld world(StoreWorld::plain());
    Client alice(world);
    ASSERT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true)) << alice.wire->text();
    ASSERT_EQ(alice.write("AllCXGroup", Dictionary()) / 100, 2);
    const AliceOwns owner;
    CXDAVACLManager own(alice.base, owner, alice.manager);
    EXPECT_TRUE(own.publisher());
    EXPECT_FALSE(own.isKnown());

    struct NobodyOwns : LocationOwner {
        UserName userForRemoteLocation(const RemoteLocation&) const override { return UserName("alice"); }
    } nobody;
    CXDAVACLManager others(alice.base, nobody, alice.manager); // as if it were another's tree that we may read
    EXPECT_EQ(others.principalsWithReadAccess(), Users{kSelf});
    EXPECT_TRUE(others.principalsWithAllAccess().empty());
    Client bob(world, "bob");
    CXDAVACLManager stranger(bob.base, nobody, bob.manager);
    EXPECT_TRUE(stranger.principalsWithReadAccess().empty()) << "a tree that may not be read";
}

} // namespace
