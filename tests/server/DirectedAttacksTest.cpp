#include "AccessWorld.h"
#include "foundation/Paths.h"
#include "server/StoreProcess.h"

#include <filesystem>
#include <fstream>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sstream>
#include <sys/stat.h>

// Attacks that took a way around the rule, each of which got through once.

namespace rolvane {
namespace {

using testing::HasSubstr;
using testing::Not;

constexpr const char* kFile = "/dav/alice/Contacts/dateFile";

std::string grantTo(const std::string& user, const std::string& privileges = "read write") {
    return AccessWorld::ace(AccessWorld::user(user), privileges);
}

// A second WebDAV place on the same host, as an administrator may have: everybody who is signed in may write there.
PrivateStoreOptions withPublicPlace() {
    PrivateStoreOptions options;
    options.extraConfiguration = {"DavDepthInfinity On",
                                  "<Location /public>",
                                  "Dav On",
                                  "AuthType Basic",
                                  "AuthName Rolvane",
                                  "AuthBasicProvider file",
                                  "AuthUserFile conf/passwords",
                                  "Require valid-user",
                                  "</Location>"};
    return options;
}

// DAV is on for the root of the site, and so above the trees.
PrivateStoreOptions withDavAbove() {
    PrivateStoreOptions options;
    options.extraConfiguration = {"DavDepthInfinity On",
                                  "<Location />",
                                  "Dav On",
                                  "AuthType Basic",
                                  "AuthName Rolvane",
                                  "AuthBasicProvider file",
                                  "AuthUserFile conf/passwords",
                                  "Require valid-user",
                                  "</Location>"};
    return options;
}

class OpenWorld : public AccessWorld {
public:
    explicit OpenWorld(PrivateStoreOptions options) : AccessWorld(std::move(options)) {
        reset();
        std::filesystem::create_directory(publicPlace());
        chmod(publicPlace().c_str(), 0777);
        chmod(store.documentRoot().c_str(), 0777);
    }
    std::string publicPlace() const { return store.documentRoot() + "/public"; }
    std::vector<std::string> inThePublicPlace() const {
        std::vector<std::string> found;
        for (const auto& entry : std::filesystem::recursive_directory_iterator(publicPlace()))
            found.push_back(entry.path().string());
        return found;
    }
};

TEST(DirectedAttacks, CopyingTheBaseElsewhereTakesTheRightToReadEveryTree) {
    const OpenWorld world(withPublicPlace());
    EXPECT_EQ(world.status("sam", "PUT", "/public/x", {}, "x"), 201) << "the place is there, and open";
    for (const char* base : {"/dav", "/dav/", "/dav/.", "//dav//"})
        for (const char* user : {"sam", "walter", "rita"})
            EXPECT_EQ(world.status(user, "COPY", base, {{"Destination", "/public/loot"}}), 403) << base << " " << user;
    EXPECT_EQ(world.status("sam", "MOVE", "/dav/", {{"Destination", "/public/loot"}}), 403);
    EXPECT_EQ(world.inThePublicPlace().size(), 1u);
    // The collection alone holds nothing of anybody's.
    EXPECT_EQ(world.status("sam", "COPY", "/dav/", {{"Destination", "/public/empty"}, {"Depth", "0"}}), 201);
    EXPECT_EQ(world.inThePublicPlace().size(), 2u);
}

TEST(DirectedAttacks, ListingTheBaseWithAllThatIsBelowShowsNobodysTree) {
    const OpenWorld world(withPublicPlace());
    for (const auto& depth :
         std::vector<std::vector<std::pair<std::string, std::string>>>{{}, {{"Depth", "infinity"}}}) {
        const RawAnswer answer = world.ask("sam", "PROPFIND", "/dav/", depth);
        EXPECT_EQ(answer.status, 403);
        EXPECT_THAT(answer.body, Not(HasSubstr("dateFile")));
    }
    EXPECT_EQ(world.ask("alice", "PROPFIND", "/dav/alice/", {{"Depth", "infinity"}}).status, 207);
    EXPECT_EQ(world.ask("sam", "PROPFIND", "/dav/", {{"Depth", "1"}}).status, 207);
}

TEST(DirectedAttacks, WhatReachesIntoTheTreesFromAboveIsJudgedByTheTrees) {
    const OpenWorld world(withDavAbove());
    EXPECT_EQ(world.status("sam", "PUT", "/x", {}, "x"), 201) << "DAV is on above, and open";
    const RawAnswer lock = world.ask("sam", "LOCK", "/", {{"Depth", "infinity"}}, AccessWorld::kLock);
    EXPECT_EQ(lock.status, 403) << "an infinite lock would keep everybody from writing";
    EXPECT_EQ(world.status("sam", "LOCK", "/", {}, AccessWorld::kLock), 403) << "no Depth is infinity";
    EXPECT_EQ(world.status("alice", "PUT", kFile, {}, "why"), 204);
    EXPECT_EQ(world.status("sam", "COPY", "/", {{"Destination", "/dav/sam/all"}}), 403);
    EXPECT_EQ(world.status("sam", "DELETE", "/"), 403);
    EXPECT_EQ(world.status("sam", "MOVE", "/", {{"Destination", "/dav/sam/all"}}), 403);
    EXPECT_EQ(world.status("sam", "COPY", "/public/", {{"Destination", "/"}}), 403);
    EXPECT_EQ(world.status("sam", "PROPFIND", "/", {{"Depth", "infinity"}}), 403);
    EXPECT_EQ(world.ask("alice", "GET", kFile).body, "why");
    EXPECT_THAT(readFile(world.store.errorLog()), HasSubstr("WebDAV is on above the trees"))
        << "the administrator is told at the start";
}

TEST(DirectedAttacks, AFileIsNeverWrittenInParts) {
    const AccessWorld world;
    world.reset();
    for (const char* user : {"alice", "walter"}) {
        const RawAnswer answer = world.ask(user, "PUT", kFile, {{"Content-Range", "bytes 0-0/3"}}, "W");
        EXPECT_EQ(answer.status, 400) << user;
        EXPECT_THAT(answer.body, HasSubstr("Content-Range")) << user;
    }
    EXPECT_EQ(world.status("rita", "PUT", kFile, {{"Content-Range", "bytes 0-0/3"}}, "W"), 403);
    EXPECT_EQ(world.ask("alice", "GET", kFile).body, "why");
}

TEST(DirectedAttacks, AWithdrawnWriterLandsNoByteOfAPartialUpload) {
    const AccessWorld world;
    world.reset();
    RawUpload upload(world.port(),
                     {"walter", "PUT", kFile, {{"Content-Range", "bytes 0-149999/150000"}}, std::string(150000, 'w')},
                     10000);
    ASSERT_EQ(world.status("alice", "ACL", "/dav/alice/Contacts/", {}, AccessWorld::acl(grantTo("rita", "read"))), 200);
    EXPECT_GE(upload.finish().status, 400);
    EXPECT_EQ(world.ask("alice", "GET", kFile).body, "why");
}

TEST(DirectedAttacks, AnOldNameOfDestinationIsNoWayAroundTheLists) {
    const AccessWorld world;
    world.reset();
    ASSERT_EQ(world.status("sam", "MKCOL", "/dav/sam/in"), 201);
    const std::string host = "localhost:" + std::to_string(world.port());
    for (const char* method : {"COPY", "MOVE"})
        for (const char* to : {"/dav/alice/Elsewhere", "/dav/sam/in/taken"}) {
            const RawAnswer answer =
                world.ask("alice", method, "/dav/alice/Contacts/", {{"New-uri", to}, {"Host", host}});
            EXPECT_EQ(answer.status, 400) << method << " " << to;
            EXPECT_THAT(answer.body, HasSubstr("Destination")) << answer.body;
        }
    EXPECT_EQ(world.ask("alice", "GET", kFile).body, "why");
    EXPECT_TRUE(std::filesystem::is_empty(world.store.userDirectory("sam") + "/in"));
}

TEST(DirectedAttacks, NamesThatNoFileSystemHoldsAreRefusedAsTooLong) {
    const AccessWorld world;
    world.reset();
    const std::string name(256, 'n'), place = "/dav/alice/" + name;
    ASSERT_EQ(world.status("alice", "PUT", "/dav/alice/x", {}, "x"), 201);
    const auto refuses = [&](const std::string& method, const std::string& target, const std::string& destination) {
        const int status = world.status("alice", method, target, {{"Destination", destination}});
        EXPECT_TRUE(status == 403 || status == 414) << status << " to " << method << " " << target.substr(0, 20);
    };
    // httpd itself looks no further than to the first collection that is not there.
    for (const std::string& target : {place, place + "/x", "/dav/alice/none/" + name + "/x"}) {
        for (const char* method : {"GET", "PUT", "DELETE", "MKCOL", "PROPFIND", "LOCK", "COPY"})
            refuses(method, target, "/dav/alice/y");
        for (const char* method : {"COPY", "MOVE"}) refuses(method, "/dav/alice/x", target);
    }
    EXPECT_EQ(world.status("alice", "PUT", "/dav/alice/" + name.substr(1), {}, "x"), 201) << "that is the longest";
    EXPECT_EQ(world.status("alice", "GET", "/dav/alice/x"), 200);
}

TEST(DirectedAttacks, AnEntryWithTwoOfWhatItHasOneOfIsRefused) {
    const AccessWorld world;
    world.reset();
    const std::string rita = AccessWorld::user("rita"), sam = AccessWorld::user("sam");
    const auto entry = [](const std::string& content) { return "<D:ace>" + content + "</D:ace>"; };
    const auto principal = [](const std::string& content) { return "<D:principal>" + content + "</D:principal>"; };
    const std::string grant = "<D:grant><D:privilege><D:read/></D:privilege></D:grant>";
    for (const std::string& ace :
         {entry(principal(rita) + principal(sam) + grant), entry(principal(rita + sam) + grant),
          entry(principal(rita) + grant + grant), entry(principal(rita + "<D:authenticated/>") + grant),
          entry(principal("<D:property><D:owner/><D:group/></D:property>") + grant),
          entry(principal(rita) + grant + "<D:deny><D:privilege><D:read/></D:privilege></D:deny>")})
        EXPECT_EQ(world.status("alice", "ACL", "/dav/alice/Contacts/", {}, AccessWorld::acl(ace)), 400) << ace;
    EXPECT_EQ(world.status("walter", "GET", kFile), 200) << "the list is what it was";
}

TEST(DirectedAttacks, APropertyThatIsProtectedIsNotPatched) {
    const AccessWorld world;
    world.reset();
    for (const char* name :
         {"acl", "owner", "current-user-privilege-set", "supported-privilege-set", "acl-restrictions",
          "inherited-acl-set", "principal-collection-set", "current-user-principal"})
        for (const char* action : {"set", "remove"}) {
            const std::string body = std::string("<D:propertyupdate xmlns:D=\"DAV:\"><D:") + action +
                                     "><D:prop><D:" + name + "/></D:prop></D:" + action + "></D:propertyupdate>";
            const RawAnswer answer = world.ask("alice", "PROPPATCH", "/dav/alice/Contacts/", {}, body);
            EXPECT_EQ(answer.status, 207) << name;
            EXPECT_THAT(answer.body, HasSubstr("HTTP/1.1 403")) << action << " " << name;
            EXPECT_THAT(answer.body, HasSubstr("cannot-modify-protected-property")) << action << " " << name;
        }
}

TEST(DirectedAttacks, ThePrivilegeToUnlockIsShownToNobodyBecauseNobodyHasIt) {
    const AccessWorld world;
    world.reset();
    for (const char* name : {"current-user-privilege-set", "supported-privilege-set"}) {
        const RawAnswer answer =
            world.ask("alice", "PROPFIND", "/dav/alice/Contacts/", {{"Depth", "0"}}, AccessWorld::propfind(name));
        EXPECT_EQ(answer.status, 207);
        EXPECT_THAT(answer.body, Not(HasSubstr("unlock"))) << name;
    }
}

TEST(DirectedAttacks, TheEntriesOfARequestAreBounded) {
    PrivateStoreOptions options;
    options.extraConfiguration = {"DavAclMaxEntries 20"};
    const AccessWorld world(options);
    world.reset();
    std::string aces;
    for (int i = 0; i < 20; ++i) aces += grantTo("rita", "read");
    EXPECT_EQ(world.status("alice", "ACL", "/dav/alice/Contacts/", {}, AccessWorld::acl(aces)), 200);
    const RawAnswer answer =
        world.ask("alice", "ACL", "/dav/alice/Contacts/", {}, AccessWorld::acl(aces + grantTo("rita", "read")));
    EXPECT_EQ(answer.status, 403);
    EXPECT_EQ(answer.precondition(), "limited-number-of-aces");
    EXPECT_THAT(answer.body, HasSubstr("20"));
}

// A check of one of these passwords takes 2^31 rounds of bcrypt, which is days: one check, and no answer comes.
TEST(DirectedAttacks, WhetherAUserExistsCostsNoPasswordCheck) {
    const AccessWorld world;
    world.reset();
    std::string slow, aces;
    for (int i = 0; i < 200; ++i) {
        const std::string user = "slow" + std::to_string(i);
        slow += user + ":$2y$31$abcdefghijklmnopqrstuuKBnYqvHyb4LDAMaMvpG7SyNcUvZ7S.K\n"; // the password is nobody's
        aces += grantTo(user, "read");
    }
    const std::string passwords = world.store.stateDirectory() + "/conf/passwords";
    std::ofstream(passwords, std::ios::app) << slow;
    EXPECT_EQ(world.status("alice", "ACL", "/dav/alice/Contacts/", {}, AccessWorld::acl(aces)), 200);
    EXPECT_EQ(world.ask("alice", "ACL", "/dav/alice/Contacts/", {}, AccessWorld::acl(grantTo("nobody-there", "read")))
                  .precondition(),
              "recognized-principal");
}

// The most memory that any process of the store's httpd has used so far, in megabytes.
long mostMemory(const AccessWorld& world) {
    long most = 0;
    for (const auto& process : StoreProcess::findAll(world.store.stateDirectory() + "/conf/httpd.conf")) {
        std::istringstream lines(readFile("/proc/" + std::to_string(process.pid()) + "/status"));
        for (std::string line; std::getline(lines, line);)
            if (line.starts_with("VmHWM:")) most = std::max(most, std::atol(line.c_str() + 6) / 1024);
    }
    return most;
}

TEST(DirectedAttacks, AListingWithListsTakesNoMemoryForMembersTimesEntries) {
    const AccessWorld world;
    world.reset();
    std::ofstream list(world.listFile("alice"));
    list << "davacl 1\n";
    for (int i = 0; i < 1000; ++i) list << "/Contacts r user somebody-with-a-long-name-" << i << "\n";
    list << "end\n";
    list.close();
    const std::string directory = world.store.userDirectory("alice") + "/Contacts/People/many";
    std::filesystem::create_directory(directory);
    for (int i = 0; i < 500; ++i) std::ofstream(directory + "/" + std::to_string(i)) << "x";
    ASSERT_EQ(::system(("chown -R --reference=" + world.store.userDirectory("alice") + " " + directory).c_str()), 0);
    const long before = mostMemory(world);
    const RawAnswer answer = world.ask("alice", "PROPFIND", "/dav/alice/Contacts/People/many/", {{"Depth", "1"}},
                                       AccessWorld::propfind("acl"));
    ASSERT_EQ(answer.status, 207);
    EXPECT_GT(answer.body.size(), 50'000'000u) << "each member shows the whole list";
    EXPECT_THAT(answer.body.substr(answer.body.size() - 200'000), HasSubstr("somebody-with-a-long-name-999"));
    EXPECT_LT(mostMemory(world) - before, 40) << "megabytes";
}

} // namespace
} // namespace rolvane
