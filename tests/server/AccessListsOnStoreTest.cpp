#include "AccessWorld.h"
#include "foundation/Paths.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

namespace rolvane {
namespace {

using testing::HasSubstr;
using testing::Not;

constexpr const char* kTree = "/dav/alice/Contacts/";
using Headers = std::vector<std::pair<std::string, std::string>>;

// One store for the tests of this file; each begins with alice's tree as it was made.
class AccessLists : public testing::Test {
protected:
    static void SetUpTestSuite() { world = std::make_unique<AccessWorld>(); }
    static void TearDownTestSuite() { world.reset(); }
    void SetUp() override { world->reset(); }

    std::string properties(const std::string& user, const std::string& path, const std::string& names) {
        const RawAnswer answer = world->ask(user, "PROPFIND", path, {{"Depth", "0"}}, AccessWorld::propfind(names));
        EXPECT_EQ(answer.status, 207) << answer.body;
        return answer.body;
    }
    RawAnswer set(const std::string& aces, const std::string& path = kTree, const std::string& user = "alice") {
        return world->ask(user, "ACL", path, {}, AccessWorld::acl(aces));
    }
    static std::unique_ptr<AccessWorld> world;
};
std::unique_ptr<AccessWorld> AccessLists::world;

TEST_F(AccessLists, AreAnnouncedByOptions) {
    const RawAnswer answer = world->ask("alice", "OPTIONS", kTree);
    EXPECT_THAT(answer.headers, testing::ContainsRegex("DAV: [^\r]*access-control"));
    EXPECT_THAT(answer.headers, testing::ContainsRegex("Allow: [^\r]*ACL"));
}

TEST_F(AccessLists, OpenTheTreeToWhomTheyName) {
    EXPECT_EQ(world->status("rita", "GET", "/dav/alice/Contacts/dateFile"), 200);
    EXPECT_EQ(world->status("greta", "GET", "/dav/alice/Contacts/dateFile"), 200);
    EXPECT_EQ(world->status("sam", "GET", "/dav/alice/Contacts/dateFile"), 403);
    EXPECT_EQ(world->status("", "GET", "/dav/alice/Contacts/dateFile"), 401);
    EXPECT_EQ(world->status("rita", "PUT", "/dav/alice/Contacts/dateFile", {}, "no"), 403);
    EXPECT_EQ(world->status("walter", "PUT", "/dav/alice/Contacts/dateFile", {}, "yes"), 204);
    EXPECT_EQ(world->status("rita", "GET", "/dav/alice/own"), 403) << "above the tree";
}

TEST_F(AccessLists, ARefusalNamesThePrivilegeAndThePlaceThatLackIt) {
    const RawAnswer read = world->ask("sam", "GET", "/dav/alice/Contacts/dateFile");
    EXPECT_EQ(read.precondition(), "need-privileges") << read.headers << read.body;
    EXPECT_THAT(read.body,
                HasSubstr("<D:resource><D:href>/dav/alice/Contacts/dateFile</D:href><D:privilege><D:read/>"));
    const RawAnswer bind = world->ask("rita", "PUT", "/dav/alice/Contacts/new", {}, "x");
    EXPECT_THAT(bind.body, HasSubstr("<D:href>/dav/alice/Contacts/</D:href><D:privilege><D:bind/>"));
    const RawAnswer unbind = world->ask("walter", "DELETE", "/dav/alice/Contacts/");
    EXPECT_EQ(unbind.status, 403);
    EXPECT_THAT(unbind.body, HasSubstr("<D:href>/dav/alice/</D:href><D:privilege><D:unbind/>"));
    const RawAnswer list = world->ask("walter", "ACL", kTree, {}, AccessWorld::lists());
    EXPECT_THAT(list.body, HasSubstr("<D:privilege><D:write-acl/>"));
    const RawAnswer copy = world->ask("rita", "COPY", "/dav/rita/own", {{"Destination", "/dav/alice/Contacts/x"}});
    EXPECT_EQ(copy.status, 403);
    EXPECT_THAT(copy.body, HasSubstr("<D:href>/dav/alice/Contacts/</D:href><D:privilege><D:bind/>"));
}

TEST_F(AccessLists, ShowTheOwnerTheWholeListAndOthersNothingOfIt) {
    const std::string list = properties("alice", kTree, "acl owner acl-restrictions inherited-acl-set");
    EXPECT_THAT(list, HasSubstr("<D:ace><D:principal><D:property><D:owner/></D:property></D:principal><D:grant>"
                                "<D:privilege><D:all/></D:privilege></D:grant><D:protected/></D:ace>"));
    EXPECT_THAT(list, HasSubstr(AccessWorld::ace(AccessWorld::user("walter"), "read write")));
    EXPECT_THAT(list, HasSubstr(AccessWorld::ace(AccessWorld::group("readers"), "read")));
    EXPECT_THAT(list, HasSubstr("<D:owner><D:href>/principals/users/alice</D:href></D:owner>"));
    EXPECT_THAT(list, HasSubstr("<D:acl-restrictions><D:no-invert/></D:acl-restrictions>"));
    EXPECT_THAT(list, HasSubstr("<D:inherited-acl-set><D:href>/dav/alice/</D:href></D:inherited-acl-set>"));
    for (const char* user : {"walter", "rita"}) {
        const std::string others = properties(user, kTree, "acl");
        EXPECT_THAT(others, HasSubstr("404 Not Found"));
        EXPECT_THAT(others, Not(HasSubstr("readers")));
    }
}

TEST_F(AccessLists, OfAFileAreInheritedFromItsTree) {
    const std::string list = properties("alice", "/dav/alice/Contacts/dateFile", "acl inherited-acl-set");
    EXPECT_THAT(list, HasSubstr("<D:inherited><D:href>/dav/alice/Contacts/</D:href></D:inherited></D:ace>"));
    EXPECT_THAT(list,
                HasSubstr("<D:inherited-acl-set><D:href>/dav/alice/Contacts/</D:href><D:href>/dav/alice/</D:href>"));
}

TEST_F(AccessLists, TellEverybodyWhatTheyMayDo) {
    const auto mine = [this](const std::string& user, const std::string& path) {
        return properties(user, path, "current-user-privilege-set");
    };
    EXPECT_THAT(mine("rita", kTree), testing::AllOf(HasSubstr("<D:read/>"), Not(HasSubstr("<D:write"))));
    EXPECT_THAT(mine("walter", kTree),
                testing::AllOf(HasSubstr("<D:write/>"), HasSubstr("<D:bind/>"), Not(HasSubstr("<D:write-acl/>"))));
    EXPECT_THAT(mine("alice", kTree), testing::AllOf(HasSubstr("<D:all/>"), HasSubstr("<D:write-acl/>")));
    EXPECT_THAT(mine("sam", "/dav/"), testing::AllOf(HasSubstr("<D:read/>"), Not(HasSubstr("<D:write"))));
    const std::string who =
        properties("rita", kTree, "current-user-principal principal-collection-set supported-privilege-set");
    EXPECT_THAT(who, HasSubstr("<D:current-user-principal><D:href>/principals/users/rita</D:href>"));
    EXPECT_THAT(who, HasSubstr("<D:href>/principals/users/</D:href><D:href>/principals/groups/</D:href>"));
    EXPECT_THAT(who, HasSubstr("<D:privilege><D:all/></D:privilege><D:abstract/>"));
}

TEST_F(AccessLists, AreNoPartOfAllProperties) {
    const RawAnswer all = world->ask("alice", "PROPFIND", kTree, {{"Depth", "0"}},
                                     "<D:propfind xmlns:D=\"DAV:\"><D:allprop/></D:propfind>");
    EXPECT_THAT(all.body, Not(HasSubstr("privilege-set")));
    const RawAnswer names = world->ask("alice", "PROPFIND", kTree, {{"Depth", "0"}},
                                       "<D:propfind xmlns:D=\"DAV:\"><D:propname/></D:propfind>");
    for (const char* name : {"owner", "supported-privilege-set", "current-user-privilege-set", "acl",
                             "acl-restrictions", "inherited-acl-set", "principal-collection-set"})
        EXPECT_THAT(names.body, HasSubstr(std::string("<D:") + name + "/>")) << name;
}

TEST_F(AccessLists, TreesThatMayNotBeReadAreNotListed) {
    world->ask("alice", "ACL", "/dav/alice/", {},
               AccessWorld::acl(AccessWorld::ace(AccessWorld::user("rita"), "read")));
    const auto list = [&](const std::string& user) {
        return world->ask(user, "PROPFIND", "/dav/", {{"Depth", "1"}}, AccessWorld::propfind("resourcetype")).body;
    };
    EXPECT_THAT(list("rita"), testing::AllOf(HasSubstr("<D:href>/dav/rita/<"), HasSubstr("<D:href>/dav/alice/<")));
    EXPECT_THAT(list("rita"), Not(HasSubstr("<D:href>/dav/sam/<")));
    EXPECT_THAT(list("sam"), testing::AllOf(HasSubstr("<D:href>/dav/sam/<"), Not(HasSubstr("alice"))));
}

TEST_F(AccessLists, AreSetOnlyWithWhatTheStoreCanKeep) {
    using W = AccessWorld;
    struct {
        const char* name;
        std::string aces;
        int status;
        const char* precondition;
    } const cases[] = {
        {"an unknown user", W::ace(W::user("nobody"), "read"), 403, "recognized-principal"},
        {"an unknown group", W::ace(W::group("nobody"), "read"), 403, "recognized-principal"},
        {"another host", W::ace("<D:href>http://example.org/principals/users/rita</D:href>", "read"), 403,
         "recognized-principal"},
        {"a principal by way of dots", W::ace("<D:href>/principals/users/x/../rita</D:href>", "read"), 403,
         "recognized-principal"},
        {"a file for a principal", W::ace("<D:href>/dav/alice/own</D:href>", "read"), 403, "recognized-principal"},
        {"whoever is not signed in", W::ace("<D:unauthenticated/>", "read"), 403, "allowed-principal"},
        {"oneself", W::ace("<D:self/>", "read"), 403, "allowed-principal"},
        {"an abstract privilege", W::ace(W::user("rita"), "bind"), 403, "no-abstract"},
        {"all privileges", W::ace(W::user("rita"), "all"), 403, "no-abstract"},
        {"an unknown privilege", W::ace(W::user("rita"), "fly"), 403, "not-supported-privilege"},
        {"a denial for the owner",
         "<D:ace><D:principal>" + W::user("alice") +
             "</D:principal><D:deny><D:privilege><D:read/></D:privilege></D:deny></D:ace>",
         403, "no-protected-ace-conflict"},
        {"a denial of all privileges",
         "<D:ace><D:principal>" + W::user("rita") +
             "</D:principal><D:deny><D:privilege><D:all/></D:privilege></D:deny></D:ace>",
         403, "no-abstract"},
        {"an inversion",
         "<D:ace><D:invert><D:principal>" + W::user("rita") +
             "</D:principal></D:invert><D:grant><D:privilege><D:read/></D:privilege></D:grant></D:ace>",
         403, "no-invert"},
        {"another's protected entry", W::ace(W::user("rita"), "all", "<D:protected/>"), 403,
         "no-protected-ace-conflict"},
        {"an inherited entry of no place above",
         W::ace(W::user("rita"), "read", "<D:inherited><D:href>/dav/sam/</D:href></D:inherited>"), 403,
         "no-inherited-ace-conflict"},
        {"an entry without principal", "<D:ace><D:grant><D:privilege><D:read/></D:privilege></D:grant></D:ace>", 400,
         ""},
        {"an entry without privileges", W::ace(W::user("rita"), ""), 400, ""},
    };
    for (const auto& c : cases) {
        const RawAnswer answer = set(c.aces);
        EXPECT_EQ(answer.status, c.status) << c.name << "\n" << answer.body;
        EXPECT_EQ(answer.precondition(), c.precondition) << c.name << "\n" << answer.body;
    }
    EXPECT_EQ(world->status("rita", "GET", "/dav/alice/Contacts/dateFile"), 200) << "the list is as it was";
    EXPECT_EQ(world->status("alice", "ACL", kTree, {}, "<D:propfind xmlns:D=\"DAV:\"/>"), 400);
    EXPECT_EQ(world->status("alice", "ACL", kTree, {}, "<not well formed"), 400);
    EXPECT_EQ(world->status("alice", "ACL", "/dav/alice/none", {}, AccessWorld::lists()), 404);
}

TEST_F(AccessLists, WhatWasReadCanBeSetAgain) {
    const std::string body = properties("alice", kTree, "acl");
    const size_t from = body.find("<D:acl>") + 7;
    const std::string entries = body.substr(from, body.find("</D:acl>") - from);
    EXPECT_EQ(set(entries).status, 200);
    const std::string again = properties("alice", kTree, "acl");
    EXPECT_EQ(again.substr(again.find("<D:acl>")), body.substr(body.find("<D:acl>")));
}

TEST_F(AccessLists, AreReplacedAsAWhole) {
    EXPECT_EQ(set(AccessWorld::ace(AccessWorld::user("sam"), "read")).status, 200);
    EXPECT_EQ(world->status("sam", "GET", "/dav/alice/Contacts/dateFile"), 200);
    EXPECT_EQ(world->status("rita", "GET", "/dav/alice/Contacts/dateFile"), 403);
    EXPECT_EQ(set("").status, 200);
    EXPECT_EQ(world->status("sam", "GET", "/dav/alice/Contacts/dateFile"), 403);
    EXPECT_EQ(world->status("alice", "GET", "/dav/alice/Contacts/dateFile"), 200);
}

TEST_F(AccessLists, MayNameEverybodyWhoIsSignedIn) {
    EXPECT_EQ(set(AccessWorld::ace("<D:authenticated/>", "read")).status, 200);
    EXPECT_EQ(world->status("sam", "GET", "/dav/alice/Contacts/dateFile"), 200);
    EXPECT_EQ(world->status("", "GET", "/dav/alice/Contacts/dateFile"), 401);
}

TEST_F(AccessLists, StandOnCollectionsNearTheOwnersRootOnly) {
    EXPECT_EQ(set(AccessWorld::ace(AccessWorld::user("sam"), "read"), "/dav/alice/").status, 200);
    const RawAnswer deep = set(AccessWorld::ace(AccessWorld::user("sam"), "read"), "/dav/alice/Contacts/People/");
    EXPECT_EQ(deep.status, 403);
    EXPECT_EQ(deep.precondition(), "limited-number-of-aces");
    EXPECT_EQ(set(AccessWorld::ace(AccessWorld::user("sam"), "read"), "/dav/alice/own").precondition(),
              "limited-number-of-aces");
}

TEST_F(AccessLists, AWriterTakesTheTreeAwayFromNobody) {
    EXPECT_EQ(world->status("walter", "DELETE", kTree), 403);
    EXPECT_EQ(world->status("walter", "MOVE", kTree, {{"Destination", "/dav/walter/mine"}}), 403);
    EXPECT_EQ(world->status("walter", "COPY", "/dav/walter/", {{"Destination", kTree}}), 403);
    EXPECT_EQ(world->status("walter", "DELETE", "/dav/alice/Contacts/People/7/1:CXPerson"), 204);
}

TEST_F(AccessLists, GoWithTheirTree) {
    EXPECT_EQ(world->status("alice", "DELETE", kTree), 204);
    EXPECT_NE(access(world->listFile("alice").c_str(), F_OK), 0) << "no list is left";
    EXPECT_EQ(world->status("alice", "MKCOL", kTree), 201);
    EXPECT_EQ(world->status("rita", "PROPFIND", kTree, {{"Depth", "0"}}), 403) << "the new tree is another one";
}

TEST_F(AccessLists, OfTheWholeOwnerGoWithTheOwnersRoot) {
    EXPECT_EQ(world->status("alice", "DELETE", "/dav/alice/"), 204);
    EXPECT_NE(access(world->listFile("alice").c_str(), F_OK), 0);
}

TEST_F(AccessLists, ThatWereLeftBehindDoNotHoldForANewTree) {
    std::filesystem::remove_all(world->store.userDirectory("alice") + "/Contacts"); // behind the server's back
    EXPECT_EQ(world->status("alice", "MKCOL", kTree), 201);
    EXPECT_EQ(world->status("rita", "PROPFIND", kTree, {{"Depth", "0"}}), 403);
}

TEST_F(AccessLists, MoveWithTheirTreeWithinTheOwnersRoot) {
    EXPECT_EQ(world->status("alice", "MOVE", kTree, {{"Destination", "/dav/alice/Other/"}}), 201);
    EXPECT_EQ(world->status("rita", "GET", "/dav/alice/Other/dateFile"), 200);
    EXPECT_EQ(world->status("rita", "PUT", "/dav/alice/Other/dateFile", {}, "x"), 403);
    EXPECT_EQ(world->status("alice", "MKCOL", kTree), 201);
    EXPECT_EQ(world->status("rita", "PROPFIND", kTree, {{"Depth", "0"}}), 403);
}

TEST_F(AccessLists, DoNotGoWithACopy) {
    EXPECT_EQ(world->status("alice", "COPY", kTree, {{"Destination", "/dav/alice/Other/"}}), 201);
    EXPECT_EQ(world->status("rita", "GET", "/dav/alice/Other/dateFile"), 403);
    EXPECT_EQ(world->status("rita", "GET", "/dav/alice/Contacts/dateFile"), 200);
    // and what is copied over loses its own
    EXPECT_EQ(world->status("alice", "COPY", "/dav/alice/Other/", {{"Destination", kTree}}), 204);
    EXPECT_EQ(world->status("rita", "GET", "/dav/alice/Contacts/dateFile"), 403);
}

TEST_F(AccessLists, ThatCannotGoAlongKeepTheirTreeWhereItIs) {
    EXPECT_EQ(set(AccessWorld::ace(AccessWorld::user("alice"), "read write"), "/dav/sam/", "sam").status, 200);
    EXPECT_EQ(world->status("alice", "MOVE", kTree, {{"Destination", "/dav/sam/Contacts"}}), 403);
    EXPECT_EQ(world->status("alice", "MOVE", kTree, {{"Destination", "/dav/alice/Other/deep"}}), 403);
    EXPECT_EQ(set("").status, 200);
    EXPECT_EQ(world->status("alice", "MOVE", kTree, {{"Destination", "/dav/sam/Contacts"}}), 201);
}

TEST_F(AccessLists, AWriteThatBeganBeforeItsRightWasWithdrawnDoesNotLand) {
    RawUpload upload(world->port(),
                     {"walter", "PUT", "/dav/alice/Contacts/dateFile", {{"Expect", "100-continue"}}, "too late"}, 0);
    ASSERT_TRUE(upload.awaitContinue()) << "it was allowed when it began";
    EXPECT_EQ(set("").status, 200);
    EXPECT_EQ(upload.finish().status, 403);
    EXPECT_EQ(world->ask("alice", "GET", "/dav/alice/Contacts/dateFile").body, "why");
}

TEST_F(AccessLists, ASlowWriterDoesNotKeepTheOwnerWaiting) {
    RawUpload upload(world->port(), {"walter", "PUT", "/dav/alice/Contacts/new", {{"Expect", "100-continue"}}, "slow"},
                     0);
    ASSERT_TRUE(upload.awaitContinue());
    EXPECT_EQ(set(AccessWorld::ace(AccessWorld::user("walter"), "read write")).status, 200);
    EXPECT_EQ(upload.finish().status, 201) << "who still may write is not disturbed";
}

std::string tokenOf(const RawAnswer& answer) {
    const size_t at = answer.headers.find("<opaquelocktoken");
    return at == std::string::npos ? "" : answer.headers.substr(at, answer.headers.find('>', at) + 1 - at);
}

TEST_F(AccessLists, AWriterCannotKeepTheOwnerFromTakingTheRightBackByLockingTheTree) {
    const RawAnswer locked =
        world->ask("walter", "LOCK", kTree, {{"Depth", "infinity"}, {"Timeout", "Infinite"}}, AccessWorld::kLock);
    ASSERT_EQ(locked.status, 200);
    EXPECT_EQ(world->status("alice", "PUT", "/dav/alice/Contacts/dateFile", {}, "x"), 423);
    EXPECT_EQ(set(AccessWorld::ace(AccessWorld::user("walter"), "read")).status, 200);
    EXPECT_EQ(world->status("alice", "PUT", "/dav/alice/Contacts/dateFile", {}, "x"), 204) << "the lock has gone";
    EXPECT_EQ(world->status("alice", "PUT", "/dav/alice/Contacts/People/7/new", {}, "x"), 201);
    EXPECT_EQ(
        world->status("walter", "PUT", "/dav/alice/Contacts/dateFile", {{"If", "(" + tokenOf(locked) + ")"}}, "no"),
        403);
}

TEST_F(AccessLists, TheLocksOfWhoMayNoLongerWriteGoWithTheRightAndOthersStay) {
    using W = AccessWorld;
    ASSERT_EQ(set(W::ace(W::user("walter"), "read write") + W::ace(W::user("sam"), "read write") +
                  W::ace(W::group("readers"), "read write"))
                  .status,
              200);
    const std::string walters = "/dav/alice/Contacts/dateFile", sams = "/dav/alice/Contacts/1:CXGroup";
    const std::string gretas = "/dav/alice/Contacts/People/7/1:CXPerson", unborn = "/dav/alice/Contacts/unborn";
    ASSERT_EQ(world->status("walter", "LOCK", walters, {}, W::kLock), 200);
    ASSERT_EQ(world->status("walter", "LOCK", unborn, {}, W::kLock), 200);
    const RawAnswer held = world->ask("sam", "LOCK", sams, {}, W::kLock);
    ASSERT_EQ(held.status, 200);
    ASSERT_EQ(world->status("greta", "LOCK", gretas, {}, W::kLock), 200);
    ASSERT_EQ(set(W::ace(W::user("sam"), "read write") + W::ace(W::group("readers"), "read write")).status, 200);
    EXPECT_EQ(world->status("alice", "PUT", walters, {}, "mine"), 204);
    EXPECT_EQ(world->status("alice", "PUT", unborn, {}, "mine") / 100, 2);
    EXPECT_EQ(world->status("alice", "PUT", sams, {}, "mine"), 423);
    EXPECT_EQ(world->status("alice", "PUT", gretas, {}, "mine"), 423) << "she may write as a member of her group";
    EXPECT_EQ(world->status("sam", "PUT", sams, {{"If", "(" + tokenOf(held) + ")"}}, "mine"), 204);
    ASSERT_EQ(set("").status, 200);
    EXPECT_EQ(world->status("alice", "PUT", gretas, {}, "mine"), 204);
}

TEST_F(AccessLists, WhoTookALockMayGiveItBackWithoutAnyRight) {
    using W = AccessWorld;
    const std::string groups = world->store.stateDirectory() + "/conf/groups";
    const std::string before = readFile(groups);
    const std::string path = "/dav/alice/Contacts/dateFile";
    ASSERT_EQ(set(W::ace(W::group("readers"), "read write")).status, 200);
    const std::string token = tokenOf(world->ask("greta", "LOCK", path, {}, W::kLock));
    writeFileDurably(groups, "readers: nobody\n", 0644); // the administrator takes her out of the group
    EXPECT_EQ(world->status("greta", "PUT", path, {{"If", "(" + token + ")"}}, "no"), 403);
    EXPECT_EQ(world->status("sam", "UNLOCK", path, {{"Lock-Token", token}}), 403) << "it is not his";
    EXPECT_EQ(world->status("greta", "UNLOCK", path, {{"Lock-Token", "<opaquelocktoken:none>"}}), 403);
    EXPECT_EQ(world->status("greta", "UNLOCK", path, {{"Lock-Token", token}}), 204);
    EXPECT_EQ(world->status("alice", "PUT", path, {}, "why"), 204);
    writeFileDurably(groups, before, 0644);
}

TEST_F(AccessLists, AreProtectedFromProppatch) {
    const RawAnswer answer = world->ask("alice", "PROPPATCH", kTree, {},
                                        "<D:propertyupdate xmlns:D=\"DAV:\"><D:set><D:prop><D:owner><D:href>"
                                        "/principals/users/sam</D:href></D:owner></D:prop></D:set></D:propertyupdate>");
    EXPECT_EQ(answer.status, 207);
    EXPECT_THAT(answer.body, testing::AnyOf(HasSubstr("HTTP/1.1 403 "), HasSubstr("HTTP/1.1 409 ")));
    EXPECT_THAT(properties("alice", kTree, "owner"), HasSubstr("/principals/users/alice"));
}

TEST_F(AccessLists, ADamagedFileLetsOnlyTheOwnerIn) {
    const std::string file = world->listFile("alice");
    std::filesystem::resize_file(file, std::filesystem::file_size(file) - 1);
    EXPECT_EQ(world->status("rita", "GET", "/dav/alice/Contacts/dateFile"), 403);
    EXPECT_EQ(world->status("alice", "GET", "/dav/alice/Contacts/dateFile"), 200);
    EXPECT_EQ(set("").status, 500) << "what is not understood is not overwritten";
    std::filesystem::remove(file);
}

// -- principals

TEST_F(AccessLists, PrincipalsAnswer) {
    const auto principal = [&](const std::string& user, const std::string& path) {
        return properties(user, path,
                          "resourcetype displayname principal-URL alternate-URI-set group-membership group-member-set");
    };
    const std::string own = principal("greta", "/principals/users/greta");
    EXPECT_THAT(own, HasSubstr("<D:resourcetype><D:principal/></D:resourcetype>"));
    EXPECT_THAT(own, HasSubstr("<D:displayname>greta</D:displayname>"));
    EXPECT_THAT(own, HasSubstr("<D:principal-URL><D:href>/principals/users/greta</D:href></D:principal-URL>"));
    EXPECT_THAT(own, HasSubstr("<D:group-membership><D:href>/principals/groups/readers</D:href></D:group-membership>"));
    EXPECT_THAT(principal("greta", "/principals/groups/readers"),
                HasSubstr("<D:group-member-set><D:href>/principals/users/greta</D:href></D:group-member-set>"));
    const std::string others = principal("sam", "/principals/users/greta");
    EXPECT_THAT(others, HasSubstr("<D:principal/>"));
    EXPECT_THAT(others, Not(HasSubstr("readers"))) << "whose groups these are is nobody else's business";
    EXPECT_EQ(world->status("sam", "PROPFIND", "/principals/users/nobody", {{"Depth", "0"}}), 404);
    EXPECT_EQ(world->status("sam", "PROPFIND", "/principals/groups/nobody", {{"Depth", "0"}}), 404);
    EXPECT_EQ(world->status("", "PROPFIND", "/principals/users/greta", {{"Depth", "0"}}), 401);
    EXPECT_EQ(world->status("sam", "PROPFIND", "/principals/", {}), 403) << "unbounded";
    EXPECT_EQ(world->status("sam", "PUT", "/principals/users/sam", {}, "x"), 405);
    const std::string all =
        world->ask("sam", "PROPFIND", "/principals/users/", {{"Depth", "1"}}, AccessWorld::propfind("displayname"))
            .body;
    EXPECT_THAT(all, testing::AllOf(HasSubstr("/principals/users/sam<"), Not(HasSubstr("greta"))));
}

} // namespace
} // namespace rolvane
