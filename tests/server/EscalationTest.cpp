#include "AccessWorld.h"
#include "foundation/Paths.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/inotify.h>
#include <unistd.h>

namespace rolvane {
namespace {

using testing::HasSubstr;
using testing::Not;

constexpr const char* kTree = "/dav/alice/Contacts/";

std::string grantTo(const std::string& user, const std::string& privileges = "read write") {
    return AccessWorld::acl(AccessWorld::ace(AccessWorld::user(user), privileges));
}

// What somebody tries who wants more than the lists give.
class Escalation : public testing::Test {
protected:
    static void SetUpTestSuite() { world = std::make_unique<AccessWorld>(); }
    static void TearDownTestSuite() { world.reset(); }
    void SetUp() override { world->reset(); }
    // Nothing of alice's came out or changed.
    void TearDown() override {
        EXPECT_EQ(world->status("sam", "GET", "/dav/alice/Contacts/dateFile"), 403);
        EXPECT_EQ(world->ask("alice", "GET", "/dav/alice/Contacts/dateFile").body, "why");
        EXPECT_EQ(world->status("rita", "PUT", "/dav/alice/Contacts/dateFile", {}, "x"), 403);
    }
    static std::unique_ptr<AccessWorld> world;
};
std::unique_ptr<AccessWorld> Escalation::world;

TEST_F(Escalation, NobodySetsTheListOfAnother) {
    for (const char* user : {"walter", "rita", "greta", "sam"})
        for (const char* path :
             {kTree, "/dav/alice/", "/dav/alice/Contacts/People/", "/dav/alice", "/dav/", "/dav/./alice/Contacts",
              "/dav//alice//Contacts//", "/dav/%61lice/Contacts/", "/dav/sam/../alice/Contacts/"})
            EXPECT_EQ(world->status(user, "ACL", path, {}, grantTo(user)), 403) << user << " " << path;
}

TEST_F(Escalation, TheListFilesCannotBeReachedThroughWebDAV) {
    const std::string lists = world->store.stateDirectory() + "/lists";
    for (const std::string path : {"/dav/../lists/alice.acl", "/dav/sam/../../lists/alice.acl", "/lists/alice.acl",
                                   "/dav/%2e%2e/lists/alice.acl", "/dav/sam/..%2f..%2f..%2flists/alice.acl",
                                   "/dav/sam/%2e%2e/%2e%2e/%2e%2e/lists/alice.acl"})
        for (const char* method : {"GET", "PUT", "DELETE", "PROPFIND"}) {
            const RawAnswer answer =
                world->ask("sam", method, path, {}, method == std::string("PUT") ? "davacl 1\nend\n" : "");
            EXPECT_GE(answer.status, 400) << method << " " << path;
            EXPECT_THAT(answer.body, Not(HasSubstr("walter")));
        }
    EXPECT_THAT(readFile(world->listFile("alice")), HasSubstr("/Contacts rw user walter"));
    std::filesystem::create_symlink(lists, world->store.userDirectory("sam") + "/link");
    EXPECT_GE(world->status("sam", "GET", "/dav/sam/link/alice.acl"), 400);
    EXPECT_GE(world->status("sam", "PUT", "/dav/sam/link/sam.acl", {}, "x"), 400);
    std::filesystem::remove(world->store.userDirectory("sam") + "/link");
}

TEST_F(Escalation, ListFilesInsideATreeAreFilesLikeOthers) {
    EXPECT_EQ(world->status("walter", "PUT", "/dav/alice/Contacts/alice.acl", {}, "davacl 1\n/ rw user walter\nend\n"),
              201);
    EXPECT_EQ(world->status("walter", "GET", "/dav/alice/own"), 403);
}

TEST_F(Escalation, HttpdsOwnFilesCannotBeWritten) {
    for (const char* name : {".htaccess", ".HTACCESS", ".htpasswd", ".DAV", ".dav", ".DAV/x", "%2ehtaccess"}) {
        const std::string path = std::string("/dav/sam/") + name;
        EXPECT_EQ(world->status("sam", "PUT", path, {}, "Require all granted"), 403) << name;
        EXPECT_EQ(world->status("sam", "COPY", "/dav/sam/own", {{"Destination", path}}), 403) << name;
        EXPECT_EQ(world->status("sam", "MKCOL", path), 403) << name;
        EXPECT_EQ(world->status("sam", "GET", path), 403) << name;
    }
    // Put there behind the server's back, it still says nothing.
    const std::string file = world->store.userDirectory("alice") + "/Contacts/.htaccess";
    writeFileDurably(file, "Require all granted\nSatisfy Any\n", 0644);
    EXPECT_EQ(world->status("sam", "GET", "/dav/alice/Contacts/dateFile"), 403);
    EXPECT_THAT(world->ask("rita", "PROPFIND", kTree, {{"Depth", "1"}}).body, Not(HasSubstr(".htaccess")));
    std::filesystem::remove(file);
}

TEST_F(Escalation, TheOwnersSegmentIsTakenToTheLetter) {
    for (const char* path : {"/dav/Alice/Contacts/dateFile", "/dav/ALICE/Contacts/dateFile", "/dav/alice%20/Contacts/x",
                             "/dav/alice./Contacts/x", "/dav/alice%00/Contacts/x", "/dav/alice;x/Contacts/dateFile",
                             "/dav/alice%5c../sam/own", "/dav/%E1lice/x", "/dav/alice%E2%80%8B/x", "/dav/al%69ce/own"})
        for (const char* method : {"GET", "PUT", "PROPFIND", "MKCOL", "ACL"}) {
            const int status = world->status("sam", method, path, {}, method == std::string("PUT") ? "x" : "");
            EXPECT_TRUE(status == 403 || status == 404 || status == 400) << status << " " << method << " " << path;
        }
    EXPECT_EQ(world->status("sam", "MKCOL", "/dav/Sam"), 403) << "another name is another owner";
}

TEST_F(Escalation, AUserNamedLikeASpecialFileIsAUserLikeOthers) {
    // Names that could be mistaken for files of the lists, of httpd or of the published tree.
    for (const char* name : {"alice.acl", "alice.lock", "dateFile", "info", "Contacts", "lists", "_end"}) {
        if (!std::filesystem::exists(world->store.userDirectory(name))) world->store.addUser(name, rawPasswordOf(name));
        EXPECT_EQ(world->status(name, "GET", "/dav/alice/Contacts/dateFile"), 403) << name;
        EXPECT_EQ(world->status(name, "PUT", std::string("/dav/") + name + "/x", {}, "x"), 201) << name;
        EXPECT_EQ(world->status(name, "ACL", std::string("/dav/") + name + "/", {}, grantTo("sam", "read")), 200)
            << name;
        EXPECT_EQ(world->status("sam", "GET", std::string("/dav/") + name + "/x"), 200) << name;
    }
    EXPECT_THAT(readFile(world->listFile("alice")), HasSubstr("/Contacts rw user walter"));
}

TEST_F(Escalation, ACopyOrMoveOpensNothing) {
    // A writer can read what it moves; a stranger moves nothing out, and nobody with a list of their own moves it in.
    EXPECT_EQ(world->status("sam", "COPY", "/dav/alice/Contacts/", {{"Destination", "/dav/sam/stolen"}}), 403);
    EXPECT_EQ(world->status("sam", "MOVE", "/dav/alice/Contacts/dateFile", {{"Destination", "/dav/sam/stolen"}}), 403);
    EXPECT_EQ(world->status("sam", "ACL", "/dav/sam/", {}, grantTo("sam")), 200);
    EXPECT_EQ(world->status("sam", "MOVE", "/dav/sam/", {{"Destination", "/dav/alice/"}}), 403);
    EXPECT_EQ(world->status("sam", "MOVE", "/dav/sam/", {{"Destination", kTree}}), 403);
    EXPECT_EQ(world->status("walter", "MOVE", "/dav/walter/", {{"Destination", "/dav/alice/Contacts/w"}}), 201)
        << "a tree without a list is only files";
    EXPECT_EQ(world->status("walter", "MKCOL", "/dav/walter"), 201);
}

TEST_F(Escalation, AListCannotBeSmuggledInWithOtherWords) {
    const char* const bodies[] = {
        "<!DOCTYPE x [<!ENTITY e SYSTEM \"file:///etc/passwd\">]><D:acl "
        "xmlns:D=\"DAV:\"><D:ace><D:principal><D:href>&e;"
        "</D:href></D:principal><D:grant><D:privilege><D:read/></D:privilege></D:grant></D:ace></D:acl>",
        "<D:acl "
        "xmlns:D=\"DAV:\"><D:ace><D:principal><D:href>/principals/users/rita%0A/Contacts%20rw%20user%20sam</D:href>"
        "</D:principal><D:grant><D:privilege><D:read/></D:privilege></D:grant></D:ace></D:acl>",
        "<D:acl xmlns:D=\"DAV:\"><D:ace><D:principal><D:href>/principals/users/%2e%2e</D:href></D:principal><D:grant>"
        "<D:privilege><D:read/></D:privilege></D:grant></D:ace></D:acl>"};
    for (const char* body : bodies) {
        const int status = world->status("alice", "ACL", kTree, {}, body);
        EXPECT_TRUE(status == 400 || status == 403) << status << "\n" << body;
    }
    EXPECT_THAT(readFile(world->listFile("alice")), Not(HasSubstr("sam")));
}

TEST_F(Escalation, AnothersLockIsGivenBackByNobodyElse) {
    const RawAnswer locked = world->ask("alice", "LOCK", "/dav/alice/Contacts/dateFile", {}, AccessWorld::kLock);
    const size_t at = locked.headers.find("<opaquelocktoken");
    ASSERT_NE(at, std::string::npos);
    const std::string token = locked.headers.substr(at, locked.headers.find('>', at) + 1 - at);
    const std::string path = "/dav/alice/Contacts/dateFile";
    EXPECT_EQ(world->status("walter", "PUT", path, {{"If", "(" + token + ")"}}, "x"), 403) << "the token is alice's";
    EXPECT_EQ(world->status("rita", "UNLOCK", path, {{"Lock-Token", token}}), 403);
    EXPECT_EQ(world->status("walter", "UNLOCK", path, {{"Lock-Token", token}}), 403);
    EXPECT_EQ(world->status("alice", "UNLOCK", path, {{"Lock-Token", token}}), 204);
}

// -- how the lists are kept and read

TEST_F(Escalation, AListingReadsItsListOnceHoweverManyMembersItHas) {
    for (int i = 0; i < 300; ++i)
        writeFileDurably(world->store.userDirectory("alice") + "/Contacts/People/7/" + std::to_string(i), "x", 0644);
    const int events = inotify_init1(IN_CLOEXEC | IN_NONBLOCK);
    ASSERT_GE(inotify_add_watch(events, world->listFile("alice").c_str(), IN_OPEN | IN_CLOSE), 0);
    const RawAnswer listing = world->ask("rita", "PROPFIND", "/dav/alice/Contacts/People/7/", {{"Depth", "1"}},
                                         AccessWorld::propfind("owner current-user-privilege-set"));
    EXPECT_EQ(listing.status, 207);
    EXPECT_THAT(listing.body, HasSubstr("/People/7/299<"));
    // Equal events in a row are one to inotify; openings and closings take turns.
    inotify_event seen[16];
    EXPECT_EQ(read(events, seen, sizeof seen), static_cast<ssize_t>(2 * sizeof(inotify_event)));
    EXPECT_EQ(seen[0].mask, static_cast<uint32_t>(IN_OPEN));
    close(events);
}

// -- other ways to sign in, and none

TEST(AccessListsWithDigest, HoldAsWithBasic) {
    const StoreDirectory directory;
    PrivateStoreOptions options = optionsIn(directory);
    options.authentication = StoreAuthentication::digest;
    PrivateStore store(options);
    for (const char* name : {"alice", "rita", "sam"}) store.addUser(name, rawPasswordOf(name));
    store.start();
    const auto client = [&](const std::string& name) {
        return CurlClient(store, name, rawPasswordOf(name), "--digest");
    };
    EXPECT_EQ(client("alice").request("PUT", "/alice/x", {}, "x").status, 201);
    EXPECT_EQ(client("alice").request("ACL", "/alice/", {}, grantTo("rita", "read")).status, 200);
    EXPECT_EQ(client("alice").request("ACL", "/alice/", {}, grantTo("nobody", "read")).status, 403);
    EXPECT_EQ(client("rita").request("GET", "/alice/x").status, 200);
    EXPECT_EQ(client("rita").request("PUT", "/alice/x", {}, "y").status, 403);
    EXPECT_EQ(client("sam").request("GET", "/alice/x").status, 403);
    EXPECT_EQ(CurlClient(store, "rita", "wrong", "--digest").request("GET", "/alice/x").status, 401);
}

TEST(AccessListsWhereAnybodyMayCome, KeepTheTreesClosedAllTheSame) {
    PrivateStoreOptions options;
    const AccessWorld world([&] {
        options.extraConfiguration = {"<Location /dav>",        "Require all granted", "</Location>",
                                      "<Location /principals>", "Require all granted", "</Location>"};
        return options;
    }());
    // Nobody is asked for a name now, and nobody has a right without one.
    world.reset();
    EXPECT_EQ(world.status("", "GET", "/dav/sam/own"), 401);
    EXPECT_EQ(world.status("", "PUT", "/dav/sam/own", {}, "x"), 401);
    EXPECT_EQ(world.status("", "PROPFIND", "/dav/", {{"Depth", "1"}}), 401);
    EXPECT_EQ(world.status("", "PROPFIND", "/principals/users/sam", {{"Depth", "0"}}), 401);
}

TEST(AStoreWithoutAccessLists, KeepsEachUserAlone) {
    PrivateStoreOptions options;
    options.accessLists = false;
    const AccessWorld world(options);
    EXPECT_EQ(world.status("alice", "PUT", "/dav/alice/x", {}, "x"), 201);
    EXPECT_EQ(world.status("sam", "GET", "/dav/alice/x"), 403);
    EXPECT_THAT(world.ask("alice", "OPTIONS", "/dav/alice/").headers, Not(HasSubstr("access-control")));
    EXPECT_GE(world.status("alice", "ACL", "/dav/alice/", {}, grantTo("sam")), 400);
    EXPECT_EQ(world.status("sam", "GET", "/dav/alice/x"), 403);
}

} // namespace
} // namespace rolvane
